// Helpers shared by the tests: a private IPC directory per test, running real
// processes, and checks that no queue or shared-memory block is left behind.
#pragma once

#include <functional>
#include <string>
#include <vector>

class msgLogger;

namespace klptest {

class RecordingLogger;

// A fresh directory under /tmp ending in "/", TMPDIR of this process and
// those it starts while the object lives; removed with its files.
class TmpDir {
 public:
  TmpDir();
  ~TmpDir();
  TmpDir(const TmpDir&) = delete;
  TmpDir& operator=(const TmpDir&) = delete;
  const std::string& path() const { return path_; }

 private:
  std::string path_, oldTmpdir_;
  bool hadTmpdir_ = false;
};

// How a process or forked child ended, and its standard output and error.
struct ProcessResult {
  bool exited = false;  // ended by exit (not a signal, not timed out)
  int exitCode = -1;    // exit status, or -1 when killed / timed out
  int signal = 0;       // terminating signal, 0 when it exited
  bool timedOut = false;
  std::string out, err;
};
using Child = ProcessResult;

// Path of a built program in the build tree's bin/ directory.
std::string binPath(const std::string& program);

// Runs argv (argv[0] is the path), with extra "NAME=value" environment
// entries on top of the current environment, waiting at most timeoutMs.
ProcessResult run(const std::vector<std::string>& argv,
                  const std::vector<std::string>& extraEnv = {}, int timeoutMs = 60000);

// A started process that runs in the background until wait() or destruction.
class Background {
 public:
  Background(const std::vector<std::string>& argv, const std::vector<std::string>& extraEnv = {});
  ~Background();  // kills with SIGKILL if still running
  int pid() const { return pid_; }
  // Waits up to timeoutMs for the process to end, then kills it.
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

// True while the queue / shared-memory block of path exists.
bool queueExists(const std::string& path);
bool memoryExists(const std::string& path);

// Reads a whole file ("" when missing).
std::string readFile(const std::string& path);

// Lines of a text, without their line feeds.
std::vector<std::string> lines(const std::string& text);

// Messages issued through the process logger, as their callers gave them, one text each:
// "number origin kind values", the values joined by "|" (kind 0 log file, 1 by severity,
// 2 console; the logger's header values and the blank pads are left out). Installed as the
// process logger for the object's life; recorded messages are not written anywhere.
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
  RecordingLogger* logger_;
  msgLogger* saved_;
};

// What f writes to standard output while it runs.
std::string stdoutOf(const std::function<void()>& f);

// Runs body in a forked child whose standard output and error go to files under dir (ending
// in "/"); it exits with body's answer or is killed after timeoutMs.
Child inChild(const std::string& dir, const std::function<int()>& body, int timeoutMs = 20000);

// The process logger a program makes first (application 10 unless given, synchronous, built-in
// texts loaded), installed for the object's life and writing to dir/file when both are given;
// the previous logger comes back. It keeps every message it issues, for take().
class ProcessLogger {
 public:
  explicit ProcessLogger(int applicationIndex = 10, const std::string& logDir = "",
                         const std::string& logFile = "");
  ~ProcessLogger();
  ProcessLogger(const ProcessLogger&) = delete;
  ProcessLogger& operator=(const ProcessLogger&) = delete;
  msgLogger* operator->() const;
  msgLogger* get() const;
  // Messages issued since the last take(): number as issued, origin, routing asked for (12:
  // destination kind 0, 35: kind 2, 1: others), values after the header ones less trailing pads
  // (" ", "*"), extra pair unless (-1,-1): "589 <where> 1: where|801|what", "575 <mq> 1: 2059|a|b (-1,2059)".
  std::vector<std::string> take();

 private:
  RecordingLogger* logger_;
  msgLogger* saved_;
};

// The process logger while the object lives, writing nowhere but a record file in dir (so that
// forked children's records count): per message "number|origin|kind|values..." with the
// destination kind 0, 1 or 2 (or "r" and the routing word given directly) and the caller's
// values in order, trailing pads (" ", "*") left out.
class LogRecords {
 public:
  explicit LogRecords(const std::string& dir);
  ~LogRecords();
  // The records so far, then forgotten; withThread puts "thread name>" first.
  std::vector<std::string> take(bool withThread = false);

 private:
  std::string file_;
  msgLogger* logger_;
  msgLogger* saved_;
};

// Polls cond every 5 ms for at most ms milliseconds.
bool waitFor(const std::function<bool()>& cond, int ms = 5000);

// The process's first prologue, once, on the calling (main) thread, with the
// signal handlers it installs given back: a test's fault is not recovered.
void mainThreadReady();

}  // namespace klptest
