// Helpers shared by the platform layer's own sources; not for other callers.
#pragma once

#include <cstdint>
#include <ctime>

struct stat;

#include "common/platform/hsv.h"
#include "common/platform/hsv_fault.h"

namespace hsvint {

// The absolute time timeoutMs from now on the given clock.
timespec deadlineAfter(clockid_t clock, int64_t timeoutMs);
// Milliseconds left until deadline on the given clock, rounded up, never
// negative.
int64_t msUntil(clockid_t clock, const timespec& deadline);

// The POSIX name of an id, checked: the id may have been copied from
// anywhere, so its text is not trusted to be NUL-ended or well formed.
bool posixName(const HSVResID& id, char (&name)[sizeof(HSVResID::part2)]);

// ECF_OK when the open object fd belongs to our effective user and grants
// nothing to group or others; ECF_NOT_OWNED otherwise. Its status goes to
// out when given.
hsvRC checkPrivate(int fd, struct stat* out = nullptr);

// Fault injection (hsv_fault.h): ECF_OK, or the code of an injected failure
// of this use of op; and a sleep or a queue wait as the armed process is to
// take it. Without KLP_FAULTS they are constants the compiler folds away.
#ifdef KLP_FAULTS
hsvRC faultCheck(hsvFaultOp op);
uint32_t faultSleepMs(uint32_t ms);
int32_t faultWaitMs(int32_t ms);
#else
inline hsvRC faultCheck(hsvFaultOp) { return ECF_OK; }
inline uint32_t faultSleepMs(uint32_t ms) { return ms; }
inline int32_t faultWaitMs(int32_t ms) { return ms; }
#endif

}  // namespace hsvint
