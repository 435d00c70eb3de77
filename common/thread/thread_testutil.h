// Helpers of the thread, list, queue and recovery tests: a logger that writes
// to a file of its own, the process's first prologue without leaving our
// signal handler in the test process, and forked children with their output
// and exit status.
#pragma once

#include <fcntl.h>
#include <signal.h>
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
    std::string key = "#" + std::to_string(number) + "|";
    for (const std::string& line : klptest::lines(klptest::readFile(tmp_.path() + "values.txt")))
      if (line.compare(0, key.size(), key) == 0) out.push_back(line);
    return out;
  }
  // True when message `number` was issued with every one of the values.
  bool issuedWith(int number, const std::vector<std::string>& values) const {
    for (const std::string& line : issued(number)) {
      bool all = true;
      for (const std::string& v : values)
        if ((line + "|").find("|" + v + "|") == std::string::npos) all = false;
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
  for (const std::string& line : klptest::lines(out))
    if (line.find(" KLP") == std::string::npos || line.compare(0, 2, "20") != 0) kept += line + "\n";
  return kept;
}

// Forked children with their output and exit status.
using klptest::Child;
using klptest::inChild;

// Polls cond every 5 ms for at most ms milliseconds.
inline bool waitFor(const std::function<bool()>& cond, int ms = 5000) {
  for (int waited = 0; waited <= ms; waited += 5) {
    if (cond()) return true;
    hsvSleep(5);
  }
  return cond();
}

}  // namespace thrtest
