// Helpers shared by the platform layer's own sources; not for other callers.
#pragma once

#include <cstdint>
#include <ctime>

namespace hsvint {

// The absolute time timeoutMs from now on the given clock.
timespec deadlineAfter(clockid_t clock, int64_t timeoutMs);
// Milliseconds left until deadline on the given clock, rounded up, never
// negative.
int64_t msUntil(clockid_t clock, const timespec& deadline);

}  // namespace hsvint
