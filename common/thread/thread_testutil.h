// Helpers of the thread, list, queue and recovery tests: a logger that writes
// to a file of its own, the process's first prologue without leaving our
// signal handler in the test process, and forked children with their output
// and exit status.
#pragma once

#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <functional>
#include <string>
#include <vector>

#include "common/msg/klplog.h"
#include "common/msg/msglogger.h"
#include "common/platform/hsv.h"
#include "common/thread/klpthread.h"
#include "tests/testing/klptest.h"

namespace thrtest {

// The signals the recovery manager takes over.
inline const int kHandled[] = {SIGINT, SIGFPE, SIGABRT, SIGSEGV, SIGBUS, SIGILL, SIGTERM};

// Runs the process's first prologue on the main thread once, then gives the
// signals back to their previous handlers: a fault in a test must not be
// "recovered" in the test process. Children that test signals reinstall the
// handler with recoveryMgr::erReinstall().
inline klpThread* mainReady() {
  klpThread* m = klpMainThread();
  if (m->tid.oleAnchor == nullptr) {
    struct sigaction old[sizeof kHandled / sizeof kHandled[0]];
    for (size_t i = 0; i < sizeof kHandled / sizeof kHandled[0]; ++i)
      sigaction(kHandled[i], nullptr, &old[i]);
    klpThread::prologue(m);
    for (size_t i = 0; i < sizeof kHandled / sizeof kHandled[0]; ++i)
      sigaction(kHandled[i], &old[i], nullptr);
  }
  return m;
}

// The process logger of a test: besides its log file it appends every
// message's number and values, "#591|v1|v2|...", to a file of its own, so
// tests check what was issued whatever the message text makes of it. Files
// survive forked children.
class RecordingLogger : public msgLoggerU {
 public:
  RecordingLogger(const std::string& valuesFile)
      : msgLoggerU(MSG_APP_KLPKCCMD, 0), valuesFile_(valuesFile) {}
  void writeLogFile(logMsg* record) override {
    msgLoggerU::writeLogFile(record);
    std::string line = "#" + std::to_string(record->msgNumber);
    for (int i = 0; i < record->valueCount; ++i)
      line += std::string("|") + (record->values[i] ? record->values[i] : "");
    line += "\n";
    int fd = open(valuesFile_.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0600);
    if (fd >= 0) {
      ssize_t ignored = write(fd, line.data(), line.size());
      (void)ignored;
      close(fd);
    }
  }

 private:
  std::string valuesFile_;
};

// A process logger writing the log file <tmp>/thr.log, for one test.
class LogCapture {
 public:
  LogCapture() : logger_(new RecordingLogger(tmp_.path() + "values.txt")) {
    logger_->loadBuiltinMsgs(builtinMsgTable);
    logger_->setLogFileName(tmp_.path().c_str(), "thr.log");
    previous_ = klpGetProcessLogger();
    klpSetProcessLogger(logger_);
  }
  ~LogCapture() {
    klpSetProcessLogger(previous_);
    delete logger_;
  }
  std::string log() const { return klptest::readFile(tmp_.path() + "thr.log"); }
  const std::string& dir() const { return tmp_.path(); }
  bool has(const std::string& text) const { return log().find(text) != std::string::npos; }
  // The value lines of message `number` ("#n|..." each).
  std::vector<std::string> issued(int number) const {
    std::vector<std::string> out;
    std::string all = klptest::readFile(tmp_.path() + "values.txt");
    std::string key = "#" + std::to_string(number) + "|";
    size_t start = 0;
    while (start < all.size()) {
      size_t nl = all.find('\n', start);
      if (nl == std::string::npos) nl = all.size();
      std::string line = all.substr(start, nl - start);
      if (line.compare(0, key.size(), key) == 0) out.push_back(line);
      start = nl + 1;
    }
    return out;
  }
  // True when message `number` was issued with every one of the values.
  bool issuedWith(int number, const std::vector<std::string>& values) const {
    for (const std::string& line : issued(number)) {
      bool all = true;
      for (const std::string& v : values)
        if (line.find("|" + v + "|") == std::string::npos &&
            line.compare(line.size() - v.size() - 1, v.size() + 1, "|" + v) != 0)
          all = false;
      if (all) return true;
    }
    return false;
  }

 private:
  klptest::TmpDir tmp_;
  msgLogger* logger_;
  msgLogger* previous_ = nullptr;
};

// Standard output without the logger's console lines.
inline std::string withoutMessages(const std::string& out) {
  std::string kept;
  size_t start = 0;
  while (start < out.size()) {
    size_t nl = out.find('\n', start);
    if (nl == std::string::npos) nl = out.size() - 1;
    std::string line = out.substr(start, nl - start + 1);
    if (line.find(" KLP") == std::string::npos || line.compare(0, 2, "20") != 0) kept += line;
    start = nl + 1;
  }
  return kept;
}

struct Child {
  bool exited = false;  // ended by exit (not a signal, not timed out)
  int exitCode = -1;
  int signal = 0;       // terminating signal
  std::string out;
};

// Runs body in a forked child with standard output in a file under dir; the
// child exits with body's answer. Waits at most timeoutMs, then kills it.
inline Child inChild(const std::string& dir, const std::function<int()>& body,
                     int timeoutMs = 10000) {
  static int serial = 0;
  std::string outFile = dir + "child" + std::to_string(++serial) + ".out";
  fflush(stdout);
  fflush(stderr);
  Child c;
  pid_t pid = fork();
  if (pid == 0) {
    int o = open(outFile.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
    if (o < 0) _exit(99);
    dup2(o, 1);
    int rc = body();
    fflush(stdout);
    _exit(rc);
  }
  if (pid < 0) return c;
  int status = 0;
  for (int waited = 0;; waited += 10) {
    if (waitpid(pid, &status, WNOHANG) == pid) {
      c.exited = WIFEXITED(status);
      c.exitCode = c.exited ? WEXITSTATUS(status) : -1;
      c.signal = WIFSIGNALED(status) ? WTERMSIG(status) : 0;
      break;
    }
    if (waited >= timeoutMs) {
      kill(pid, SIGKILL);
      waitpid(pid, &status, 0);
      break;
    }
    hsvSleep(10);
  }
  c.out = klptest::readFile(outFile);
  return c;
}

// Polls cond every 5 ms for at most ms milliseconds.
inline bool waitFor(const std::function<bool()>& cond, int ms = 5000) {
  for (int waited = 0; waited <= ms; waited += 5) {
    if (cond()) return true;
    hsvSleep(5);
  }
  return cond();
}

}  // namespace thrtest
