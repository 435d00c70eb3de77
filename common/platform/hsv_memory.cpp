// Inter-process shared memory over POSIX shared memory objects.
#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "common/platform/hsv.h"
#include "common/platform/hsv_internal.h"

using hsvint::posixName;

namespace {

// Why a block name is taken: by a block of ours (ECF_ALREADY_EXISTS) or by
// one we must not use (ECF_NOT_OWNED).
hsvRC takenBy(const char* name) {
  int fd = shm_open(name, O_RDONLY, 0);
  if (fd < 0) return errno == EACCES ? ECF_NOT_OWNED : ECF_ALREADY_EXISTS;
  hsvRC rc = hsvint::checkPrivate(fd);
  close(fd);
  return rc == ECF_NOT_OWNED ? ECF_NOT_OWNED : ECF_ALREADY_EXISTS;
}

}  // namespace

HSVHIPCMemory::HSVHIPCMemory() = default;

HSVHIPCMemory::~HSVHIPCMemory() { detach(); }

hsvRC HSVHIPCMemory::create(const HSVResID& id, size_t size, int /*option*/) {
  if (addr_) return ECF_INVALID_ARGUMENT;  // already holds a block
  if (size == 0 || size > static_cast<size_t>(PTRDIFF_MAX)) return ECF_INVALID_ARGUMENT;
  char name[sizeof(HSVResID::part2)];
  if (!posixName(id, name)) return ECF_INVALID_ARGUMENT;
  if (hsvRC f = hsvint::faultCheck(HSV_FAULT_MEMORY_CREATE)) return f;
  int fd = shm_open(name, O_RDWR | O_CREAT | O_EXCL, 0600);
  if (fd < 0) return errno == EEXIST ? takenBy(name) : hsvErrnoToECF(errno);
  // A new object is zero-filled by the kernel; ftruncate only sizes it.
  struct stat st{};
  if (fstat(fd, &st) != 0 || ftruncate(fd, static_cast<off_t>(size)) != 0) {
    int err = errno;
    close(fd);
    shm_unlink(name);
    return err == EFBIG ? ECF_INVALID_ARGUMENT : hsvErrnoToECF(err);
  }
  void* p = mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
  int err = errno;
  close(fd);
  if (p == MAP_FAILED) {
    shm_unlink(name);
    return hsvErrnoToECF(err);
  }
  addr_ = p;
  size_ = size;
  id_ = id;
  dev_ = st.st_dev;
  ino_ = st.st_ino;
  return ECF_OK;
}

hsvRC HSVHIPCMemory::attach(const HSVResID& id) {
  if (addr_) return ECF_INVALID_ARGUMENT;
  char name[sizeof(HSVResID::part2)];
  if (!posixName(id, name)) return ECF_INVALID_ARGUMENT;
  if (hsvRC f = hsvint::faultCheck(HSV_FAULT_MEMORY_ATTACH)) return f;
  int fd = shm_open(name, O_RDWR, 0);
  if (fd < 0) return hsvErrnoToECF(errno);
  struct stat st{};
  hsvRC owned = hsvint::checkPrivate(fd, &st);
  if (owned != ECF_OK) {
    close(fd);
    return owned;
  }
  // A creator that has not sized the block yet leaves it empty: there is
  // nothing to attach to until it has.
  if (st.st_size <= 0) {
    close(fd);
    return ECF_NOT_FOUND;
  }
  size_t size = static_cast<size_t>(st.st_size);
  void* p = mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
  int err = errno;
  close(fd);
  if (p == MAP_FAILED) return hsvErrnoToECF(err);
  addr_ = p;
  size_ = size;
  id_ = id;
  dev_ = st.st_dev;
  ino_ = st.st_ino;
  return ECF_OK;
}

hsvRC HSVHIPCMemory::detach() {
  if (!addr_) return ECF_NOT_ATTACHED;
  munmap(addr_, size_);
  addr_ = nullptr;
  size_ = 0;
  return ECF_OK;
}

// Another process may have removed the name and made a new block under it
// since this one was attached: only the name of the object still mapped
// here is removed. Compared while it is mapped, so its inode cannot have
// been handed on.
hsvRC HSVHIPCMemory::destroy() {
  if (!addr_) return ECF_NOT_ATTACHED;
  char name[sizeof(HSVResID::part2)];
  bool named = posixName(id_, name);
  hsvRC rc = named ? ECF_OK : ECF_INVALID_ARGUMENT;
  if (named) {
    int fd = shm_open(name, O_RDONLY, 0);
    struct stat st{};
    if (fd < 0)
      rc = hsvErrnoToECF(errno);
    else if (fstat(fd, &st) != 0 || st.st_dev != dev_ || st.st_ino != ino_)
      rc = ECF_NOT_FOUND;
    if (fd >= 0) close(fd);
  }
  detach();
  if (rc == ECF_OK && shm_unlink(name) != 0) rc = hsvErrnoToECF(errno);
  return rc;
}
