// Clocks, sleeping, process and thread ids, one-time initialisation.
#include <pthread.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <ctime>

#include "common/platform/hsv.h"
#include "common/platform/hsv_internal.h"

namespace hsvint {

timespec deadlineAfter(clockid_t clock, int64_t timeoutMs) {
  timespec now{};
  clock_gettime(clock, &now);
  if (timeoutMs < 0) timeoutMs = 0;
  timespec d{};
  d.tv_sec = now.tv_sec + static_cast<time_t>(timeoutMs / 1000);
  d.tv_nsec = now.tv_nsec + static_cast<long>(timeoutMs % 1000) * 1000000L;
  if (d.tv_nsec >= 1000000000L) {
    d.tv_sec += 1;
    d.tv_nsec -= 1000000000L;
  }
  return d;
}

int64_t msUntil(clockid_t clock, const timespec& deadline) {
  timespec now{};
  clock_gettime(clock, &now);
  int64_t ns = (static_cast<int64_t>(deadline.tv_sec) - now.tv_sec) * 1000000000LL +
               (deadline.tv_nsec - now.tv_nsec);
  if (ns <= 0) return 0;
  return (ns + 999999) / 1000000;
}

}  // namespace hsvint

int32_t hsvProcessID() { return static_cast<int32_t>(getpid()); }

uint64_t hsvThreadID() { return static_cast<uint64_t>(syscall(SYS_gettid)); }

HSVTimeUTC hsvTimeGetUTC() {
  timespec ts{};
  clock_gettime(CLOCK_REALTIME, &ts);
  HSVTimeUTC t;
  t.seconds = ts.tv_sec;
  t.microseconds = static_cast<int32_t>(ts.tv_nsec / 1000);
  return t;
}

bool hsvTimeLocalTime(int64_t seconds, struct tm* out) {
  if (!out) return false;
  time_t t = static_cast<time_t>(seconds);
  return localtime_r(&t, out) != nullptr;
}

bool hsvTimeGmTime(int64_t seconds, struct tm* out) {
  if (!out) return false;
  time_t t = static_cast<time_t>(seconds);
  return gmtime_r(&t, out) != nullptr;
}

void hsvSleep(uint32_t milliseconds) {
  milliseconds = hsvint::faultSleepMs(milliseconds);
  timespec req{};
  req.tv_sec = static_cast<time_t>(milliseconds / 1000);
  req.tv_nsec = static_cast<long>(milliseconds % 1000) * 1000000L;
  // A signal must not cut the pause short: go on with what is left.
  timespec rem{};
  while (nanosleep(&req, &rem) != 0 && errno == EINTR) req = rem;
}

namespace {

pthread_once_t gOnce = PTHREAD_ONCE_INIT;

// Nothing needs process-wide set-up yet; the stack walker of trap dumps is
// prepared separately (hsvTrapFilePrepare), only by programs that run threads.
void initOnce() {}

}  // namespace

hsvRC hsvOneTimeOnly() {
  return pthread_once(&gOnce, initOnce) == 0 ? ECF_OK : ECF_SYSTEM_ERROR;
}
