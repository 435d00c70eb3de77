// Ownership of inter-process objects. Their names are predictable, so another
// local user could make a server's queue or trace block before we do and read
// or forge what passes through it: an object is used only when it is ours and
// private.
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "common/platform/hsv.h"
#include "common/platform/hsv_internal.h"

hsvRC hsvint::checkPrivate(int fd, struct stat* out) {
  struct stat st{};
  if (fstat(fd, &st) != 0) return hsvErrnoToECF(errno);
  if (out) *out = st;
  if (st.st_uid != geteuid() || (st.st_mode & 077) != 0) return ECF_NOT_OWNED;
  return ECF_OK;
}
