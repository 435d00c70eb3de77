#include "tests/testing/klptest.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <stdexcept>
#include <thread>

#include "common/msg/msglogger.h"
#include "common/platform/hsv.h"

extern char** environ;

namespace klptest {

TmpDir::TmpDir() {
  char tmpl[] = "/tmp/klptest.XXXXXX";
  if (!mkdtemp(tmpl)) throw std::runtime_error("mkdtemp failed");
  path_ = std::string(tmpl) + "/";
  if (const char* old = getenv("TMPDIR")) {
    hadTmpdir_ = true;
    oldTmpdir_ = old;
  }
  setenv("TMPDIR", path_.c_str(), 1);
}

TmpDir::~TmpDir() {
  std::error_code ec;
  std::filesystem::remove_all(path_, ec);
  if (hadTmpdir_)
    setenv("TMPDIR", oldTmpdir_.c_str(), 1);
  else
    unsetenv("TMPDIR");
}

std::string binPath(const std::string& program) { return std::string(KLP_BIN_DIR) + "/" + program; }

namespace {

std::vector<std::string> mergedEnv(const std::vector<std::string>& extra) {
  std::vector<std::string> env;
  for (char** e = environ; *e; ++e) {
    std::string entry(*e);
    std::string name = entry.substr(0, entry.find('='));
    bool overridden = false;
    for (auto& x : extra)
      if (x.substr(0, x.find('=')) == name) overridden = true;
    if (!overridden) env.push_back(entry);
  }
  for (auto& x : extra)
    if (x.find('=') != std::string::npos) env.push_back(x);
  return env;
}

std::vector<char*> cstrs(std::vector<std::string>& v) {
  std::vector<char*> p;
  for (auto& s : v) p.push_back(s.data());
  p.push_back(nullptr);
  return p;
}

int spawn(const std::vector<std::string>& argvIn, const std::vector<std::string>& extraEnv,
          const std::string& outFile, const std::string& errFile) {
  std::vector<std::string> argv = argvIn;
  std::vector<std::string> env = mergedEnv(extraEnv);
  auto a = cstrs(argv);
  auto e = cstrs(env);
  posix_spawn_file_actions_t fa;
  posix_spawn_file_actions_init(&fa);
  posix_spawn_file_actions_addopen(&fa, 0, "/dev/null", O_RDONLY, 0);
  posix_spawn_file_actions_addopen(&fa, 1, outFile.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
  posix_spawn_file_actions_addopen(&fa, 2, errFile.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
  pid_t pid = -1;
  int rc = posix_spawn(&pid, a[0], &fa, nullptr, a.data(), e.data());
  posix_spawn_file_actions_destroy(&fa);
  if (rc != 0) throw std::runtime_error("posix_spawn " + argv[0] + ": " + strerror(rc));
  return pid;
}

std::string outputName(const char* kind) {
  static int seq = 0;
  const char* dir = getenv("TMPDIR");
  std::string d = dir && *dir ? dir : "/tmp/";
  if (d.back() != '/') d += '/';
  return d + "proc." + std::to_string(getpid()) + "." + std::to_string(++seq) + "." + kind;
}

// Waits for pid up to timeoutMs; fills exit code or signal.
bool reap(int pid, int timeoutMs, ProcessResult& r) {
  auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
  for (;;) {
    int status = 0;
    pid_t w = waitpid(pid, &status, WNOHANG);
    if (w == pid) {
      if (WIFEXITED(status)) r.exitCode = WEXITSTATUS(status);
      if (WIFSIGNALED(status)) r.signal = WTERMSIG(status);
      return true;
    }
    if (std::chrono::steady_clock::now() >= deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
  }
}

}  // namespace

std::string readFile(const std::string& path) {
  std::ifstream f(path, std::ios::binary);
  std::stringstream ss;
  ss << f.rdbuf();
  return ss.str();
}

std::vector<std::string> lines(const std::string& text) {
  std::vector<std::string> out;
  for (size_t start = 0; start < text.size();) {
    size_t nl = text.find('\n', start);
    if (nl == std::string::npos) nl = text.size();
    out.push_back(text.substr(start, nl - start));
    start = nl + 1;
  }
  return out;
}

class LogCapture::Recorder : public msgLoggerU {
 public:
  Recorder() : msgLoggerU(MSG_APP_KLPKCCMD, 0) { loadBuiltinMsgs(builtinMsgTable); }
  std::vector<std::string> records;

  void setRouting(logMsg* r) override {
    char qt[MSG_QUALIFIER_MAX + MSG_THREAD_NAME_MAX + 8];
    qualifierAndThread(r->threadName, qt, sizeof qt);
    int from = 0, to = r->valueCount;
    auto is = [&](int i, const char* v) { return i < to && strcmp(r->values[i], v) == 0; };
    if (is(0, getApplicationName()) && is(1, qt)) from = 2;
    else if (is(0, qt)) from = 1;
    while (to > from && is(to - 1, " ")) --to;
    int kind = r->routing == 12 ? 0 : (r->routing & MSG_DEST_STDOUT) ? 2 : 1;
    std::string line = std::to_string(r->internalNumber ? r->internalNumber : r->msgNumber) +
                       " " + r->origin + " " + std::to_string(kind) + " ";
    for (int i = from; i < to; ++i) line += (i > from ? "|" : "") + std::string(r->values[i]);
    records.push_back(line);
    r->routing = 0;
  }
};

LogCapture::LogCapture() : logger_(new Recorder), saved_(klpGetProcessLogger()) {
  klpSetProcessLogger(logger_);
}

LogCapture::~LogCapture() {
  klpSetProcessLogger(saved_);
  delete logger_;
}

msgLogger* LogCapture::get() const { return logger_; }

std::vector<std::string> LogCapture::take() {
  std::vector<std::string> r;
  r.swap(logger_->records);
  return r;
}

Child inChild(const std::string& dir, const std::function<int()>& body, int timeoutMs) {
  static int serial = 0;
  std::string base = dir + "child" + std::to_string(++serial);
  std::string outFile = base + ".out", errFile = base + ".err";
  fflush(stdout);
  fflush(stderr);
  Child c;
  pid_t pid = fork();
  if (pid == 0) {
    int o = open(outFile.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
    int e = open(errFile.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
    if (o < 0 || e < 0) _exit(99);
    dup2(o, 1);
    dup2(e, 2);
    int rc = body();
    fflush(stdout);
    fflush(stderr);
    _exit(rc);
  }
  if (pid < 0) return c;
  ProcessResult r;
  if (reap(pid, timeoutMs, r)) {
    c.exited = r.signal == 0;
    c.exitCode = r.exitCode;
    c.signal = r.signal;
  } else {
    ::kill(pid, SIGKILL);
    reap(pid, 10000, r);
  }
  c.out = readFile(outFile);
  c.err = readFile(errFile);
  return c;
}

ProcessResult run(const std::vector<std::string>& argv, const std::vector<std::string>& extraEnv,
                  int timeoutMs) {
  Background p(argv, extraEnv);
  return p.wait(timeoutMs);
}

Background::Background(const std::vector<std::string>& argv, const std::vector<std::string>& extraEnv)
    : outFile_(outputName("out")), errFile_(outputName("err")) {
  pid_ = spawn(argv, extraEnv, outFile_, errFile_);
}

Background::~Background() {
  if (!reaped_ && pid_ > 0) {
    ::kill(pid_, SIGKILL);
    reap(pid_, 10000, result_);
  }
  unlink(outFile_.c_str());
  unlink(errFile_.c_str());
}

ProcessResult Background::wait(int timeoutMs) {
  if (!reaped_) {
    if (reap(pid_, timeoutMs, result_)) {
      reaped_ = true;
    } else {
      ::kill(pid_, SIGKILL);
      reap(pid_, 10000, result_);
      reaped_ = true;
      result_.timedOut = true;
      result_.exitCode = -1;
    }
  }
  result_.out = out();
  result_.err = err();
  return result_;
}

void Background::kill(int sig) {
  if (!reaped_) ::kill(pid_, sig);
}

bool Background::running() {
  if (reaped_) return false;
  int status = 0;
  pid_t w = waitpid(pid_, &status, WNOHANG);
  if (w == pid_) {
    reaped_ = true;
    if (WIFEXITED(status)) result_.exitCode = WEXITSTATUS(status);
    if (WIFSIGNALED(status)) result_.signal = WTERMSIG(status);
    return false;
  }
  return true;
}

std::string Background::out() const { return readFile(outFile_); }
std::string Background::err() const { return readFile(errFile_); }

bool queueExists(const std::string& path) {
  HSVResID id;
  if (hsvIPCGetQueResID(path.c_str(), HSV_QUEUE_RESID_OPTION, &id) != ECF_OK) return false;
  HSVHIPCQueue q;
  bool found = q.attach(id) == ECF_OK;
  if (found) q.detach();
  return found;
}

bool memoryExists(const std::string& path) {
  HSVResID id;
  if (hsvIPCGetResID(path.c_str(), HSV_MEMORY_RESID_OPTION, &id) != ECF_OK) return false;
  HSVHIPCMemory m;
  bool found = m.attach(id) == ECF_OK;
  if (found) m.detach();
  return found;
}

ProcessLogger::ProcessLogger(int applicationIndex, const std::string& logDir,
                             const std::string& logFile)
    : logger_(createMsgLoggerU(applicationIndex, 0)), saved_(klpGetProcessLogger()) {
  if (logger_ == nullptr) throw std::runtime_error("no memory for the logger");
  logger_->loadBuiltinMsgs(builtinMsgTable);
  if (!logDir.empty() && !logFile.empty()) logger_->setLogFileName(logDir.c_str(), logFile.c_str());
  klpSetProcessLogger(logger_);
}

ProcessLogger::~ProcessLogger() {
  klpSetProcessLogger(saved_);
  delete logger_;
}

}  // namespace klptest
