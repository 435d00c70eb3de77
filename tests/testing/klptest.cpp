#include "tests/testing/klptest.h"

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <sstream>
#include <stdexcept>
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
  for (char** e = environ; *e; ++e)
    if (std::none_of(extra.begin(), extra.end(), [&](auto& x) { return name(x) == name(*e); }))
      env.push_back(*e);
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
  static std::atomic<int> seq{0};  // tests start processes from several threads
  const char* dir = getenv("TMPDIR");
  std::string d = std::string(dir && *dir ? dir : "/tmp") + "/";
  return d + "proc." + std::to_string(getpid()) + "." + std::to_string(++seq) + "." + kind;
}

// Waits for pid up to timeoutMs; fills exit code or signal.
bool reap(int pid, int timeoutMs, ProcessResult& r) {
  int status = 0;
  bool ended = false;
  if (!waitFor([&] { return ended || (ended = waitpid(pid, &status, WNOHANG) == pid); }, timeoutMs))
    return false;
  r.exited = WIFEXITED(status);
  if (r.exited) r.exitCode = WEXITSTATUS(status);
  if (WIFSIGNALED(status)) r.signal = WTERMSIG(status);
  return true;
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
  std::istringstream in(text);
  for (std::string line; std::getline(in, line);) out.push_back(line);
  return out;
}

// The one recorder behind ProcessLogger (issued), LogCapture (captured) and
// LogRecords (filed): each words a message its own way, without the header
// values the logger put in front and the trailing pads.
enum class Form { issued, captured, filed };
thread_local int composing = 0;  // the number a message was issued with

class RecordingLogger : public msgLoggerU {
 public:
  RecordingLogger(int app, Form form, std::string file = "")
      : msgLoggerU(app, 0), form_(form), file_(std::move(file)) {
    loadBuiltinMsgs(builtinMsgTable);
  }
  void composeKlpMsg(logMsg* r) override {
    composing = r->msgNumber;
    msgLoggerU::composeKlpMsg(r);
  }
  void writeConsole(logMsg* r) override { if (form_ != Form::filed) msgLoggerU::writeConsole(r); }
  void writeStderr(logMsg* r) override { if (form_ != Form::filed) msgLoggerU::writeStderr(r); }
  void setRouting(logMsg* r) override {
    char qt[MSG_QUALIFIER_MAX + MSG_THREAD_NAME_MAX + 8];
    qualifierAndThread(r->threadName, qt, sizeof qt);
    auto is = [r](int i, const char* v) { return i < r->valueCount && strcmp(r->values[i], v) == 0; };
    int i = is(0, getApplicationName()) && is(1, qt) ? 2 : is(0, qt) ? 1 : 0, end = r->valueCount;
    if (form_ == Form::issued && i == 0) i = is(0, getApplicationName());
    while (end > i && (is(end - 1, " ") || (form_ != Form::captured && is(end - 1, "*")))) --end;
    std::string values, line;
    for (int k = i; k < end; ++k) values += (k > i ? "|" : "") + std::string(r->values[k]);
    auto number = [](long long n) { return std::to_string(n); };
    if (form_ == Form::issued) {
      line = number(composing) + " <" + r->origin + "> " + number(r->routing) + ":" +
             (i < end ? " " + values : "");
      if (r->extra[0] != -1 || r->extra[1] != -1)
        line += " (" + number(r->extra[0]) + "," + number(r->extra[1]) + ")";
    } else if (form_ == Form::captured) {
      int kind = r->routing == 12 ? 0 : (r->routing & MSG_DEST_STDOUT) ? 2 : 1;
      line = number(r->internalNumber ? r->internalNumber : r->msgNumber) + " " + r->origin + " " +
             number(kind) + " " + values;
    } else {
      int k = r->routing == 12 ? 0 : r->routing == 1 ? 1 : r->routing == 35 ? 2 : -1;
      std::ofstream(file_, std::ios::app)
          << r->threadName << ">" << r->msgNumber << "|" << r->origin << "|"
          << (k < 0 ? "r" + number(r->routing) : number(k)) << (i < end ? "|" : "") << values << "\n";
    }
    if (form_ != Form::filed) {
      std::lock_guard<std::mutex> hold(lock_);
      records_.push_back(line);
    }
    if (form_ == Form::captured) r->routing = 0;  // written nowhere
    else msgLoggerU::setRouting(r);
  }
  std::vector<std::string> take() {
    std::lock_guard<std::mutex> hold(lock_);
    return std::exchange(records_, {});
  }

 private:
  Form form_;
  std::string file_;
  std::mutex lock_;
  std::vector<std::string> records_;
};

// Installs logger as the process logger; answers the one it replaces.
static msgLogger* install(msgLogger* logger) {
  msgLogger* old = klpGetProcessLogger();
  klpSetProcessLogger(logger);
  return old;
}

LogCapture::LogCapture()
    : logger_(new RecordingLogger(MSG_APP_KLPKCCMD, Form::captured)), saved_(install(logger_)) {}
LogCapture::~LogCapture() { install(saved_), delete logger_; }
msgLogger* LogCapture::get() const { return logger_; }
std::vector<std::string> LogCapture::take() { return logger_->take(); }

ProcessLogger::ProcessLogger(int applicationIndex, const std::string& logDir,
                             const std::string& logFile)
    : logger_(new RecordingLogger(applicationIndex, Form::issued)), saved_(install(logger_)) {
  if (!logDir.empty() && !logFile.empty()) logger_->setLogFileName(logDir.c_str(), logFile.c_str());
}
ProcessLogger::~ProcessLogger() { install(saved_), delete logger_; }
msgLogger* ProcessLogger::operator->() const { return logger_; }
msgLogger* ProcessLogger::get() const { return logger_; }
std::vector<std::string> ProcessLogger::take() { return logger_->take(); }

// The records go to a file so that forked children's count too.
LogRecords::LogRecords(const std::string& dir)
    : file_(dir + "records"), logger_(new RecordingLogger(10, Form::filed, file_)),
      saved_(install(logger_)) {}
LogRecords::~LogRecords() { install(saved_), delete logger_; }

std::vector<std::string> LogRecords::take(bool withThread) {
  std::vector<std::string> out = lines(readFile(file_));
  std::ofstream(file_, std::ios::trunc).flush();
  for (std::string& line : out)
    if (!withThread) line.erase(0, line.find('>') + 1);
  return out;
}

std::string stdoutOf(const std::function<void()>& f) {
  fflush(stdout);
  ::testing::internal::CaptureStdout();
  f();
  fflush(stdout);
  return ::testing::internal::GetCapturedStdout();
}

Child inChild(const std::string& dir, const std::function<int()>& body, int timeoutMs) {
  static std::atomic<int> serial{0};
  std::string base = dir + "child" + std::to_string(++serial);
  std::string outFile = base + ".out", errFile = base + ".err";
  fflush(stdout), fflush(stderr);
  pid_t pid = fork();
  if (pid == 0) {
    int o = open(outFile.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
    int e = open(errFile.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
    if (o < 0 || e < 0) _exit(99);
    dup2(o, 1), dup2(e, 2);
    int rc = body();
    fflush(stdout), fflush(stderr);
    _exit(rc);
  }
  Child c;
  if (pid < 0) return c;
  reapOrKill(pid, timeoutMs, c);
  c.out = readFile(outFile), c.err = readFile(errFile);
  return c;
}

ProcessResult run(const std::vector<std::string>& argv, const std::vector<std::string>& extraEnv,
                  int timeoutMs) {
  return Background(argv, extraEnv).wait(timeoutMs);
}

Background::Background(const std::vector<std::string>& argv, const std::vector<std::string>& extraEnv)
    : outFile_(outputName("out")), errFile_(outputName("err")) {
  pid_ = spawn(argv, extraEnv, outFile_, errFile_);
}

Background::~Background() {
  if (!reaped_ && pid_ > 0) reapOrKill(pid_, 0, result_);
  unlink(outFile_.c_str()), unlink(errFile_.c_str());
}

ProcessResult Background::wait(int timeoutMs) {
  if (!reaped_) reapOrKill(pid_, timeoutMs, result_);
  reaped_ = true;
  result_.out = out(), result_.err = err();
  return result_;
}

void Background::kill(int sig) { if (!reaped_) ::kill(pid_, sig); }

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
