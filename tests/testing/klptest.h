// Helpers shared by the tests: a private IPC directory per test, running real
// processes, and checks that no queue or shared-memory block is left behind.
#pragma once

#include <functional>
#include <string>
#include <vector>

class msgLogger;

namespace klptest {

// A fresh directory under /tmp, set as TMPDIR for this process (and so for
// every process it starts) while the object lives; removed with its files.
class TmpDir {
 public:
  TmpDir();
  ~TmpDir();
  TmpDir(const TmpDir&) = delete;
  TmpDir& operator=(const TmpDir&) = delete;
  // The directory with a trailing "/".
  const std::string& path() const { return path_; }

 private:
  std::string path_;
  std::string oldTmpdir_;
  bool hadTmpdir_ = false;
};

struct ProcessResult {
  int exitCode = -1;    // exit status, or -1 when killed / timed out
  int signal = 0;       // terminating signal, 0 when it exited
  bool timedOut = false;
  std::string out;      // standard output
  std::string err;      // standard error
};

// Path of a built program in the build tree's bin/ directory.
std::string binPath(const std::string& program);

// Runs argv (argv[0] is the path), with extra "NAME=value" environment
// entries on top of the current environment, waiting at most timeoutMs.
ProcessResult run(const std::vector<std::string>& argv,
                  const std::vector<std::string>& extraEnv = {}, int timeoutMs = 60000);

// A started process that runs in the background until stop() or destruction.
class Background {
 public:
  Background(const std::vector<std::string>& argv, const std::vector<std::string>& extraEnv = {});
  ~Background();  // kills with SIGKILL if still running
  int pid() const { return pid_; }
  // Waits up to timeoutMs for the process to end; the result is complete
  // once it ended.
  ProcessResult wait(int timeoutMs = 60000);
  void kill(int sig);
  bool running();
  // Output so far (read from the files the process writes to).
  std::string out() const;
  std::string err() const;

 private:
  int pid_ = -1;
  bool reaped_ = false;
  ProcessResult result_;
  std::string outFile_, errFile_;
};

// True while a POSIX message queue / shared-memory block derived from path
// exists on the system.
bool queueExists(const std::string& path);
bool memoryExists(const std::string& path);

// Reads a whole file ("" when missing).
std::string readFile(const std::string& path);

// Lines of a text, without their line feeds.
std::vector<std::string> lines(const std::string& text);

// Messages issued through the process logger, recorded as their callers gave
// them, one text each: "number origin kind values", the values joined by "|"
// (kind 0 log file, 1 by severity, 2 console; the header values the logger
// puts in front and the blank pads are left out). Installed as the process
// logger for the object's life; recorded messages are not written anywhere.
class LogCapture {
 public:
  LogCapture();
  ~LogCapture();
  LogCapture(const LogCapture&) = delete;
  LogCapture& operator=(const LogCapture&) = delete;
  msgLogger* get() const;
  // The records since the last call.
  std::vector<std::string> take();

 private:
  class Recorder;
  Recorder* logger_;
  msgLogger* saved_;
};

struct Child {
  bool exited = false;  // ended by exit (not a signal, not timed out)
  int exitCode = -1;
  int signal = 0;       // terminating signal
  std::string out;      // standard output
  std::string err;      // standard error
};

// Runs body in a forked child whose standard output and error go to files
// under dir (which ends in "/"); the child exits with body's answer. Waits
// at most timeoutMs, then kills it.
Child inChild(const std::string& dir, const std::function<int()>& body, int timeoutMs = 20000);

// The process logger a program makes first (application 10 unless given,
// synchronous, built-in texts loaded), installed for the object's life and
// writing to dir/file when both are given; the previous logger comes back.
class ProcessLogger {
 public:
  explicit ProcessLogger(int applicationIndex = 10, const std::string& logDir = "",
                         const std::string& logFile = "");
  ~ProcessLogger();
  ProcessLogger(const ProcessLogger&) = delete;
  ProcessLogger& operator=(const ProcessLogger&) = delete;
  msgLogger* operator->() const { return logger_; }
  msgLogger* get() const { return logger_; }

 private:
  msgLogger* logger_;
  msgLogger* saved_;
};

}  // namespace klptest
