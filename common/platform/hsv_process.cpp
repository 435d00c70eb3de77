// Starting helper processes with posix_spawn.
#include <fcntl.h>
#include <limits.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "common/platform/hsv.h"
#include "common/platform/hsv_internal.h"

extern char** environ;

namespace {

// "<directory of this executable>/<program>" when that file can be run.
bool besideExecutable(const char* program, char* path, size_t size) {
  ssize_t n = readlink("/proc/self/exe", path, size - 1);
  if (n <= 0) return false;
  path[n] = '\0';
  char* slash = strrchr(path, '/');
  if (slash == nullptr) return false;
  size_t dirLen = static_cast<size_t>(slash - path) + 1;
  if (dirLen + strlen(program) + 1 > size) return false;
  strcpy(path + dirLen, program);
  return access(path, X_OK) == 0;
}

}  // namespace

hsvRC hsvStartProcess(const char* program, const char* const* argv, int32_t* pid) {
  if (program == nullptr || program[0] == '\0' || argv == nullptr || pid == nullptr)
    return ECF_INVALID_ARGUMENT;
  if (hsvRC f = hsvint::faultCheck(HSV_FAULT_PROCESS_START)) return f;
  char path[PATH_MAX];
  bool found = strchr(program, '/') == nullptr && besideExecutable(program, path, sizeof path);

  posix_spawn_file_actions_t actions;
  posix_spawnattr_t attr;
  if (posix_spawn_file_actions_init(&actions) != 0) return ECF_NO_MEMORY;
  if (posix_spawnattr_init(&attr) != 0) {
    posix_spawn_file_actions_destroy(&actions);
    return ECF_NO_MEMORY;
  }
  for (int fd = 0; fd <= 2; ++fd)
    posix_spawn_file_actions_addopen(&actions, fd, "/dev/null", fd == 0 ? O_RDONLY : O_WRONLY, 0);
  // A session of its own keeps it out of the terminal's signals; default
  // dispositions and an empty mask keep it out of the caller's choices.
  sigset_t none, all;
  sigemptyset(&none);
  sigfillset(&all);
  posix_spawnattr_setsigmask(&attr, &none);
  posix_spawnattr_setsigdefault(&attr, &all);
  posix_spawnattr_setflags(&attr, POSIX_SPAWN_SETSID | POSIX_SPAWN_SETSIGMASK |
                                      POSIX_SPAWN_SETSIGDEF);
  pid_t child = -1;
  char* const* args = const_cast<char* const*>(argv);
  int err = found ? posix_spawn(&child, path, &actions, &attr, args, environ)
                  : posix_spawnp(&child, program, &actions, &attr, args, environ);
  posix_spawnattr_destroy(&attr);
  posix_spawn_file_actions_destroy(&actions);
  if (err != 0) return err == ENOENT || err == EACCES ? ECF_NOT_FOUND : hsvErrnoToECF(err);
  *pid = child;
  return ECF_OK;
}

hsvRC hsvWaitProcess(int32_t pid, int* exitCode) {
  if (hsvRC f = hsvint::faultCheck(HSV_FAULT_PROCESS_WAIT)) return f;
  int status = 0;
  pid_t got;
  do {
    got = waitpid(pid, &status, 0);
  } while (got < 0 && errno == EINTR);
  if (got < 0) return hsvErrnoToECF(errno);
  if (exitCode != nullptr) *exitCode = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  return ECF_OK;
}
