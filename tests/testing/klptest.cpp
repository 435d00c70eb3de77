#include "tests/testing/klptest.h"

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <stdexcept>
#include <thread>
#include <utility>

#include <gtest/gtest.h>

#include "common/msg/msglogger.h"
#include "common/platform/hsv.h"
#include "common/thread/klpthread.h"

extern char** environ;

namespace klptest {

TmpDir::TmpDir() {
  char tmpl[] = "/tmp/klptest.XXXXXX";
  if (!mkdtemp(tmpl)) throw std::runtime_error("mkdtemp failed");
  path_ = std::string(tmpl) + "/";
  if ((hadTmpdir_ = getenv("TMPDIR") != nullptr)) oldTmpdir_ = getenv("TMPDIR");
  setenv("TMPDIR", path_.c_str(), 1);
}

TmpDir::~TmpDir() {
  std::error_code ec;
  std::filesystem::remove_all(path_, ec);
  hadTmpdir_ ? setenv("TMPDIR", oldTmpdir_.c_str(), 1) : unsetenv("TMPDIR");
}

std::string binPath(const std::string& program) { return std::string(KLP_BIN_DIR) + "/" + program; }

namespace {

// The current environment with the extra "NAME=value" entries put over it.
std::vector<std::string> mergedEnv(const std::vector<std::string>& extra) {
  std::vector<std::string> env;
  auto name = [](const std::string& entry) { return entry.substr(0, entry.find('=')); };
  for (char** e = environ; *e; ++e) {
    bool overridden = false;
    for (auto& x : extra) overridden = overridden || name(x) == name(*e);
    if (!overridden) env.push_back(*e);
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

int spawn(std::vector<std::string> argv, const std::vector<std::string>& extraEnv,
          const std::string& outFile, const std::string& errFile) {
  std::vector<std::string> env = mergedEnv(extraEnv);
  auto a = cstrs(argv), e = cstrs(env);
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
  std::string d = std::string(dir && *dir ? dir : "/tmp") + "/";
  return d + "proc." + std::to_string(getpid()) + "." + std::to_string(++seq) + "." + kind;
}

// Waits for pid up to timeoutMs; fills exit code or signal.
bool reap(int pid, int timeoutMs, ProcessResult& r) {
  auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
  for (;;) {
    int status = 0;
    pid_t w = waitpid(pid, &status, WNOHANG);
    if (w == pid) {
      r.exited = WIFEXITED(status);
      if (WIFEXITED(status)) r.exitCode = WEXITSTATUS(status);
      if (WIFSIGNALED(status)) r.signal = WTERMSIG(status);
      return true;
    }
    if (std::chrono::steady_clock::now() >= deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
  }
}

// reap, killing pid when it has not ended within timeoutMs.
void reapOrKill(int pid, int timeoutMs, ProcessResult& r) {
  if (reap(pid, timeoutMs, r)) return;
  ::kill(pid, SIGKILL);
  reap(pid, 10000, r);
  r.timedOut = true;
}

}  // namespace

std::string readFile(const std::string& path) {
  std::ifstream f(path, std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(f), {});
}

std::vector<std::string> lines(const std::string& text) {
  std::vector<std::string> out;
  for (size_t start = 0; start < text.size();) {
    size_t nl = std::min(text.find('\n', start), text.size());
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

std::string stdoutOf(const std::function<void()>& f) {
  fflush(stdout);
  ::testing::internal::CaptureStdout();
  f();
  fflush(stdout);
  return ::testing::internal::GetCapturedStdout();
}

Child inChild(const std::string& dir, const std::function<int()>& body, int timeoutMs) {
  static int serial = 0;
  std::string base = dir + "child" + std::to_string(++serial);
  std::string outFile = base + ".out", errFile = base + ".err";
  fflush(stdout);
  fflush(stderr);
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
  Child c;
  if (pid < 0) return c;
  reapOrKill(pid, timeoutMs, c);
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
  if (!reaped_ && pid_ > 0) reapOrKill(pid_, 0, result_);
  unlink(outFile_.c_str());
  unlink(errFile_.c_str());
}

ProcessResult Background::wait(int timeoutMs) {
  if (!reaped_) reapOrKill(pid_, timeoutMs, result_);
  reaped_ = true;
  result_.out = out();
  result_.err = err();
  return result_;
}

void Background::kill(int sig) {
  if (!reaped_) ::kill(pid_, sig);
}

bool Background::running() {
  if (!reaped_) reaped_ = reap(pid_, 0, result_);
  return !reaped_;
}

std::string Background::out() const { return readFile(outFile_); }
std::string Background::err() const { return readFile(errFile_); }

template <class Object>
bool exists(const std::string& path, hsvRC (*idOf)(const char*, int, HSVResID*), int option) {
  HSVResID id;
  Object o;  // detaches when it goes
  return idOf(path.c_str(), option, &id) == ECF_OK && o.attach(id) == ECF_OK;
}
bool queueExists(const std::string& path) {
  return exists<HSVHIPCQueue>(path, hsvIPCGetQueResID, HSV_QUEUE_RESID_OPTION);
}
bool memoryExists(const std::string& path) {
  return exists<HSVHIPCMemory>(path, hsvIPCGetResID, HSV_MEMORY_RESID_OPTION);
}

// Notes each message as setRouting sees it, by its number before composing.
thread_local int composing = 0;
class RecordingLogger : public msgLoggerU {
 public:
  explicit RecordingLogger(int applicationIndex) : msgLoggerU(applicationIndex, 0) {}
  void composeKlpMsg(logMsg* r) override {
    composing = r->msgNumber;
    msgLoggerU::composeKlpMsg(r);
  }
  void setRouting(logMsg* r) override {
    std::string qt = std::string(getProgramQualifier()) + "\" : \"" + r->threadName, pads = " *";
    int i = 0, last = r->valueCount;
    if (i < last && getApplicationName() == std::string(r->values[i])) ++i;
    if (i < last && qt == r->values[i]) ++i;
    while (last > i && strlen(r->values[last - 1]) == 1 && pads.find(r->values[last - 1][0]) < 2)
      --last;
    std::string line = std::to_string(composing) + " <" + r->origin + "> ";
    line += std::to_string(r->routing) + ":";
    for (char sep = ' '; i < last; ++i, sep = '|') line += sep + std::string(r->values[i]);
    if (r->extra[0] != -1 || r->extra[1] != -1)
      line += " (" + std::to_string(r->extra[0]) + "," + std::to_string(r->extra[1]) + ")";
    std::lock_guard<std::mutex> hold(lock_);
    issued_.push_back(line);
    msgLoggerU::setRouting(r);
  }
  std::vector<std::string> take() {
    std::lock_guard<std::mutex> hold(lock_);
    return std::exchange(issued_, {});
  }

 private:
  std::mutex lock_;
  std::vector<std::string> issued_;
};

ProcessLogger::ProcessLogger(int applicationIndex, const std::string& logDir,
                             const std::string& logFile)
    : logger_(new RecordingLogger(applicationIndex)), saved_(klpGetProcessLogger()) {
  logger_->loadBuiltinMsgs(builtinMsgTable);
  if (!logDir.empty() && !logFile.empty()) logger_->setLogFileName(logDir.c_str(), logFile.c_str());
  klpSetProcessLogger(logger_);
}

ProcessLogger::~ProcessLogger() {
  klpSetProcessLogger(saved_);
  delete logger_;
}

msgLogger* ProcessLogger::operator->() const { return logger_; }
msgLogger* ProcessLogger::get() const { return logger_; }
std::vector<std::string> ProcessLogger::take() { return logger_->take(); }

// ---------------------------------------------------------------------------
// Logged records; waiting for a condition; the process's first prologue
// ---------------------------------------------------------------------------
namespace {

class FileRecordingLogger : public msgLoggerU {
 public:
  explicit FileRecordingLogger(const std::string& file) : msgLoggerU(10, 0), file_(file) {
    loadBuiltinMsgs(builtinMsgTable);
  }
  void writeConsole(logMsg*) override {}
  void writeStderr(logMsg*) override {}
  void setRouting(logMsg* r) override {  // every record, with the routing asked for
    char qt[MSG_QUALIFIER_MAX + MSG_THREAD_NAME_MAX + 8];
    qualifierAndThread(r->threadName, qt, sizeof qt);
    auto is = [r](int i, const char* v) { return i < r->valueCount && strcmp(r->values[i], v) == 0; };
    int first = is(0, getApplicationName()) && is(1, qt) ? 2 : is(0, qt) ? 1 : 0, end = r->valueCount;
    while (end > first && (is(end - 1, " ") || is(end - 1, "*"))) --end;
    int k = r->routing == 12 ? 0 : r->routing == 1 ? 1 : r->routing == 35 ? 2 : -1;
    std::string line = std::string(r->threadName) + ">" + std::to_string(r->msgNumber) + "|" +
                       r->origin + "|" + (k < 0 ? "r" + std::to_string(r->routing) : std::to_string(k));
    for (int i = first; i < end; ++i) line += std::string("|") + r->values[i];
    std::ofstream(file_, std::ios::app) << line << "\n";
    msgLoggerU::setRouting(r);
  }

 private:
  std::string file_;
};

}  // namespace

LogRecords::LogRecords(const std::string& dir)
    : file_(dir + "records"), logger_(new FileRecordingLogger(file_)), saved_(klpGetProcessLogger()) {
  klpSetProcessLogger(logger_);
}

LogRecords::~LogRecords() {
  klpSetProcessLogger(saved_);
  delete logger_;
}

std::vector<std::string> LogRecords::take(bool withThread) {
  std::vector<std::string> out = lines(readFile(file_));
  std::ofstream(file_, std::ios::trunc).flush();
  for (std::string& line : out)
    if (!withThread) line.erase(0, line.find('>') + 1);
  return out;
}

bool waitFor(const std::function<bool()>& cond, int ms) {
  for (int waited = 0; waited < ms && !cond(); waited += 5) hsvSleep(5);
  return cond();
}

void mainThreadReady() {
  if (klpMainThread()->tid.oleAnchor != nullptr) return;
  const int sigs[] = {SIGINT, SIGFPE, SIGABRT, SIGSEGV, SIGBUS, SIGILL, SIGTERM, erStopSignal()};
  struct sigaction old[8];
  for (int i = 0; i < 8; ++i) sigaction(sigs[i], nullptr, &old[i]);
  klpThread::prologue(klpMainThread());
  for (int i = 0; i < 8; ++i) sigaction(sigs[i], &old[i], nullptr);
}

}  // namespace klptest
