// Trap file: the dump file written when a thread traps. dump() may run in a
// signal handler, so it allocates nothing and uses no stdio: the text is
// built in a fixed buffer with its own formatters and written with write().
#include <execinfo.h>
#include <fcntl.h>
#include <pthread.h>
#include <signal.h>
#include <ucontext.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <ctime>

#include "common/platform/hsv.h"
#include "common/platform/hsv_internal.h"

namespace {

// A line buffer that never overflows: what does not fit is dropped.
class Text {
 public:
  void str(const char* s) {
    while (*s && len_ < sizeof buf_) buf_[len_++] = *s++;
  }
  void chr(char c) {
    if (len_ < sizeof buf_) buf_[len_++] = c;
  }
  void dec(int64_t v) {
    char tmp[24];
    int n = 0;
    uint64_t u = v < 0 ? 0 - static_cast<uint64_t>(v) : static_cast<uint64_t>(v);
    do {
      tmp[n++] = static_cast<char>('0' + u % 10);
      u /= 10;
    } while (u);
    if (v < 0) chr('-');
    while (n) chr(tmp[--n]);
  }
  // Decimal, zero-padded to width digits.
  void dec0(uint64_t v, int width) {
    char tmp[24];
    int n = 0;
    do {
      tmp[n++] = static_cast<char>('0' + v % 10);
      v /= 10;
    } while (v && n < 20);
    while (n < width && n < 20) tmp[n++] = '0';
    while (n) chr(tmp[--n]);
  }
  void hex(uint64_t v) {
    static const char kDigits[] = "0123456789abcdef";
    char tmp[16];
    int n = 0;
    do {
      tmp[n++] = kDigits[v & 0xf];
      v >>= 4;
    } while (v);
    str("0x");
    while (n) chr(tmp[--n]);
  }
  const char* data() const { return buf_; }
  size_t size() const { return len_; }

 private:
  char buf_[1024];
  size_t len_ = 0;
};

const char* signalName(int sig) {
  switch (sig) {
    case SIGSEGV: return "SIGSEGV";
    case SIGBUS: return "SIGBUS";
    case SIGILL: return "SIGILL";
    case SIGFPE: return "SIGFPE";
    case SIGABRT: return "SIGABRT";
    case SIGINT: return "SIGINT";
    case SIGTERM: return "SIGTERM";
    case SIGQUIT: return "SIGQUIT";
    case SIGHUP: return "SIGHUP";
    case SIGPIPE: return "SIGPIPE";
    case SIGALRM: return "SIGALRM";
    case SIGTRAP: return "SIGTRAP";
    case SIGSYS: return "SIGSYS";
    case SIGUSR1: return "SIGUSR1";
    case SIGUSR2: return "SIGUSR2";
    case SIGXCPU: return "SIGXCPU";
    case SIGXFSZ: return "SIGXFSZ";
    case 0: return "none";
    default: return "unknown signal";
  }
}

// UTC date and time of epoch seconds by plain arithmetic (gmtime_r is not
// on the async-signal-safe list); days become a civil date through
// 400-year eras, which also gets the leap years right.
void utcText(Text& t, int64_t secs, int64_t usecs) {
  int64_t days = secs / 86400;
  int64_t rem = secs % 86400;
  if (rem < 0) {
    rem += 86400;
    --days;
  }
  int64_t z = days + 719468;
  int64_t era = (z >= 0 ? z : z - 146096) / 146097;
  int64_t doe = z - era * 146097;
  int64_t yoe = (doe - doe / 1460 + doe / 36524 - doe / 146096) / 365;
  int64_t y = yoe + era * 400;
  int64_t doy = doe - (365 * yoe + yoe / 4 - yoe / 100);
  int64_t mp = (5 * doy + 2) / 153;
  int64_t d = doy - (153 * mp + 2) / 5 + 1;
  int64_t m = mp < 10 ? mp + 3 : mp - 9;
  if (m <= 2) ++y;
  t.dec(y);
  t.chr('-');
  t.dec0(static_cast<uint64_t>(m), 2);
  t.chr('-');
  t.dec0(static_cast<uint64_t>(d), 2);
  t.chr(' ');
  t.dec0(static_cast<uint64_t>(rem / 3600), 2);
  t.chr(':');
  t.dec0(static_cast<uint64_t>(rem / 60 % 60), 2);
  t.chr(':');
  t.dec0(static_cast<uint64_t>(rem % 60), 2);
  t.chr('.');
  t.dec0(static_cast<uint64_t>(usecs), 6);
  t.str(" UTC");
}

// "<number> (<name>)<between><pid><then><tid>": the signal and who took it.
void whoTrapped(Text& t, int signalNumber, const char* between, const char* then) {
  t.dec(signalNumber);
  t.str(" (");
  t.str(signalName(signalNumber));
  t.str(between);
  t.dec(getpid());
  t.str(then);
  t.dec(static_cast<int64_t>(hsvThreadID()));
}

hsvRC writeAll(int fd, const void* buf, size_t len) {
  const char* p = static_cast<const char*>(buf);
  while (len > 0) {
    ssize_t n = ::write(fd, p, len);
    if (n < 0) {
      if (errno == EINTR) continue;
      return hsvErrnoToECF(errno);
    }
    if (n == 0) return ECF_SYSTEM_ERROR;
    p += n;
    len -= static_cast<size_t>(n);
  }
  return ECF_OK;
}

}  // namespace

void hsvTrapLine(int signalNumber, const char* threadName) {
  int savedErrno = errno;
  Text t;
  t.str("KLP trap: signal ");
  whoTrapped(t, signalNumber, ") in process ", ", thread ");
  if (threadName != nullptr && threadName[0] != '\0') {
    t.str(" (");
    t.str(threadName);
    t.chr(')');
  }
  t.chr('\n');
  writeAll(STDERR_FILENO, t.data(), t.size());
  errno = savedErrno;
}

HSVTrapFile::HSVTrapFile() = default;

HSVTrapFile::~HSVTrapFile() { close(); }

namespace {
pthread_once_t gTrapOnce = PTHREAD_ONCE_INIT;
void prepareStackWalker() {
  void* frames[2];
  (void)backtrace(frames, 2);
}
}  // namespace

void hsvTrapFilePrepare() { pthread_once(&gTrapOnce, prepareStackWalker); }

hsvRC HSVTrapFile::open(const char* path, int /*option*/) {
  if (!path || !*path) return ECF_INVALID_ARGUMENT;
  close();
  if (hsvRC f = hsvint::faultCheck(HSV_FAULT_TRAPFILE_OPEN)) return f;
  hsvTrapFilePrepare();
  int fd;
  do {
    fd = ::open(path, O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600);
  } while (fd < 0 && errno == EINTR);
  if (fd < 0) return hsvErrnoToECF(errno);
  fd_ = fd;
  return ECF_OK;
}

hsvRC HSVTrapFile::seekToEnd() {
  if (fd_ < 0) return ECF_NOT_ATTACHED;
  if (lseek(fd_, 0, SEEK_END) < 0) return hsvErrnoToECF(errno);
  return ECF_OK;
}

hsvRC HSVTrapFile::write(const void* buf, size_t len) {
  if (fd_ < 0) return ECF_NOT_ATTACHED;
  if (!buf && len > 0) return ECF_INVALID_ARGUMENT;
  if (hsvRC f = hsvint::faultCheck(HSV_FAULT_TRAPFILE_WRITE)) return f;
  return writeAll(fd_, buf, len);
}

hsvRC HSVTrapFile::dump(int /*option*/, int signalNumber, const void* siginfo,
                        const void* ucontext) {
  if (fd_ < 0) return ECF_NOT_ATTACHED;
  if (hsvRC f = hsvint::faultCheck(HSV_FAULT_TRAPFILE_WRITE)) return f;
  int savedErrno = errno;  // a handler must leave errno as it found it
  Text t;
  t.str("*** Trap dump ***\nSignal: ");
  whoTrapped(t, signalNumber, ")\nProcess id: ", "\nThread id: ");
  timespec now{};
  clock_gettime(CLOCK_REALTIME, &now);
  t.str("\nTime: ");
  utcText(t, now.tv_sec, now.tv_nsec / 1000);
  t.chr('\n');
  if (siginfo) {
    const siginfo_t* si = static_cast<const siginfo_t*>(siginfo);
    t.str("Signal code: ");
    t.dec(si->si_code);
    t.chr('\n');
    if (signalNumber == SIGSEGV || signalNumber == SIGBUS || signalNumber == SIGILL ||
        signalNumber == SIGFPE || signalNumber == SIGTRAP) {
      t.str("Fault address: ");
      t.hex(reinterpret_cast<uintptr_t>(si->si_addr));
      t.chr('\n');
    }
  }
#if defined(__x86_64__)
  if (ucontext) {
    const ucontext_t* uc = static_cast<const ucontext_t*>(ucontext);
    t.str("Instruction pointer: ");
    t.hex(static_cast<uint64_t>(uc->uc_mcontext.gregs[REG_RIP]));
    t.str("\nStack pointer: ");
    t.hex(static_cast<uint64_t>(uc->uc_mcontext.gregs[REG_RSP]));
    t.chr('\n');
  }
#elif defined(__aarch64__)
  if (ucontext) {
    const ucontext_t* uc = static_cast<const ucontext_t*>(ucontext);
    t.str("Instruction pointer: ");
    t.hex(static_cast<uint64_t>(uc->uc_mcontext.pc));
    t.str("\nStack pointer: ");
    t.hex(static_cast<uint64_t>(uc->uc_mcontext.sp));
    t.chr('\n');
  }
#else
  (void)ucontext;
#endif
  t.str("Stack trace:\n");
  hsvRC rc = writeAll(fd_, t.data(), t.size());
  if (rc == ECF_OK) {
    void* frames[64];
    int n = backtrace(frames, 64);
    if (n > 0) backtrace_symbols_fd(frames, n, fd_);
    static const char kEnd[] = "*** End of trap dump ***\n";
    rc = writeAll(fd_, kEnd, sizeof kEnd - 1);
  }
  errno = savedErrno;
  return rc;
}

hsvRC HSVTrapFile::close() {
  if (fd_ < 0) return ECF_NOT_ATTACHED;
  int fd = fd_;
  fd_ = -1;
  // The descriptor is gone even when close reports EINTR; never retry it.
  if (::close(fd) != 0 && errno != EINTR) return hsvErrnoToECF(errno);
  return ECF_OK;
}
