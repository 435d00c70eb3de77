// Helpers shared by the platform layer's own sources; not for other callers.
#pragma once

#include <cstdint>
#include <ctime>

struct stat;

#include "common/platform/hsv.h"

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

}  // namespace hsvint
