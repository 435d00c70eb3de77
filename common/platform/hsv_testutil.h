// Test helpers for the platform layer: work in a forked child, reaped with a
// bounded wait.
#pragma once

#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <functional>
#include <thread>

namespace hsvtest {

// Runs body in a child process; its return value is the exit code.
inline pid_t forkRun(const std::function<int()>& body) {
  pid_t pid = fork();
  if (pid == 0) {
    int rc = 99;
    rc = body();
    _exit(rc);
  }
  return pid;
}

// Exit code of the child, 128 + signal when killed, -1 when it did not end
// within timeoutMs (it is killed then).
inline int waitChild(pid_t pid, int timeoutMs = 20000) {
  if (pid <= 0) return -2;
  auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
  for (;;) {
    int status = 0;
    pid_t w = waitpid(pid, &status, WNOHANG);
    if (w == pid) {
      if (WIFEXITED(status)) return WEXITSTATUS(status);
      if (WIFSIGNALED(status)) return 128 + WTERMSIG(status);
      return -3;
    }
    if (std::chrono::steady_clock::now() >= deadline) {
      kill(pid, SIGKILL);
      waitpid(pid, &status, 0);
      return -1;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
  }
}

inline int64_t nowMs() {
  return std::chrono::duration_cast<std::chrono::milliseconds>(
             std::chrono::steady_clock::now().time_since_epoch())
      .count();
}

}  // namespace hsvtest
