// Inter-process message queues over POSIX message queues. Every message is
// sent with the same priority, so the kernel keeps them in arrival order.
#include <fcntl.h>
#include <mqueue.h>
#include <poll.h>

#include <cerrno>
#include <climits>
#include <cstring>

#include "common/platform/hsv.h"
#include "common/platform/hsv_internal.h"

using hsvint::posixName;

namespace {

// Why a queue name is taken: by a queue of ours (ECF_ALREADY_EXISTS) or by
// one we must not use (ECF_NOT_OWNED).
hsvRC takenBy(const char* name) {
  mqd_t q = mq_open(name, O_RDONLY);
  if (q == static_cast<mqd_t>(-1)) return errno == EACCES ? ECF_NOT_OWNED : ECF_ALREADY_EXISTS;
  hsvRC rc = hsvint::checkPrivate(q);
  mq_close(q);
  return rc == ECF_NOT_OWNED ? ECF_NOT_OWNED : ECF_ALREADY_EXISTS;
}

}  // namespace

HSVHIPCQueue::HSVHIPCQueue() = default;

HSVHIPCQueue::~HSVHIPCQueue() { detach(); }

hsvRC HSVHIPCQueue::create(const HSVResID& id, size_t maxMsgSize, int /*option*/) {
  if (fd_ >= 0) return ECF_INVALID_ARGUMENT;  // already holds a queue
  if (maxMsgSize == 0 || maxMsgSize > static_cast<size_t>(LONG_MAX)) return ECF_INVALID_ARGUMENT;
  char name[sizeof(HSVResID::part2)];
  if (!posixName(id, name)) return ECF_INVALID_ARGUMENT;
  if (hsvRC f = hsvint::faultCheck(HSV_FAULT_QUEUE_CREATE)) return f;
  mq_attr attr{};
  attr.mq_maxmsg = HSV_QUEUE_DEPTH;
  attr.mq_msgsize = static_cast<long>(maxMsgSize);
  mqd_t q = mq_open(name, O_RDWR | O_CREAT | O_EXCL, 0600, &attr);
  if (q == static_cast<mqd_t>(-1)) return errno == EEXIST ? takenBy(name) : hsvErrnoToECF(errno);
  fd_ = q;
  msgSize_ = maxMsgSize;
  id_ = id;
  return ECF_OK;
}

hsvRC HSVHIPCQueue::attach(const HSVResID& id) {
  if (fd_ >= 0) return ECF_INVALID_ARGUMENT;
  char name[sizeof(HSVResID::part2)];
  if (!posixName(id, name)) return ECF_INVALID_ARGUMENT;
  if (hsvRC f = hsvint::faultCheck(HSV_FAULT_QUEUE_ATTACH)) return f;
  mqd_t q = mq_open(name, O_RDWR);
  if (q == static_cast<mqd_t>(-1)) return hsvErrnoToECF(errno);
  hsvRC owned = hsvint::checkPrivate(q);
  if (owned != ECF_OK) {
    mq_close(q);
    return owned;
  }
  mq_attr attr{};
  if (mq_getattr(q, &attr) != 0 || attr.mq_msgsize <= 0) {
    int err = errno;
    mq_close(q);
    return hsvErrnoToECF(err ? err : EINVAL);
  }
  fd_ = q;
  msgSize_ = static_cast<size_t>(attr.mq_msgsize);
  id_ = id;
  return ECF_OK;
}

hsvRC HSVHIPCQueue::detach() {
  if (fd_ < 0) return ECF_NOT_ATTACHED;
  mq_close(fd_);
  fd_ = -1;
  msgSize_ = 0;
  return ECF_OK;
}

hsvRC HSVHIPCQueue::destroy() {
  if (fd_ < 0) return ECF_NOT_ATTACHED;
  char name[sizeof(HSVResID::part2)];
  bool named = posixName(id_, name);
  detach();
  if (!named) return ECF_INVALID_ARGUMENT;
  if (mq_unlink(name) != 0) return hsvErrnoToECF(errno);
  return ECF_OK;
}

hsvRC HSVHIPCQueue::put(const void* buf, size_t len) { return putWait(buf, len, HSV_PUT_WAIT_MS); }

hsvRC HSVHIPCQueue::putWait(const void* buf, size_t len, int32_t waitMs) {
  if (fd_ < 0) return ECF_NOT_ATTACHED;
  if (!buf && len > 0) return ECF_INVALID_ARGUMENT;
  if (len > msgSize_) return ECF_MSG_TOO_BIG;
  if (hsvRC f = hsvint::faultCheck(HSV_FAULT_QUEUE_PUT)) return f;
  waitMs = hsvint::faultWaitMs(waitMs);
  static const char kEmpty = 0;
  const char* data = buf ? static_cast<const char*>(buf) : &kEmpty;
  // The deadline is absolute, so a retry after a signal waits only for what
  // is left of it.
  timespec deadline = hsvint::deadlineAfter(CLOCK_REALTIME, waitMs);
  for (;;) {
    int rc = waitMs < 0 ? mq_send(fd_, data, len, 0) : mq_timedsend(fd_, data, len, 0, &deadline);
    if (rc == 0) return ECF_OK;
    if (errno == EINTR) continue;
    if (errno == ETIMEDOUT) return ECF_QUEUE_FULL;
    return hsvErrnoToECF(errno);
  }
}

hsvRC HSVHIPCQueue::get(void* buf, size_t capacity, size_t* outLen, int32_t timeoutMs) {
  if (outLen) *outLen = 0;
  if (fd_ < 0) return ECF_NOT_ATTACHED;
  if (!buf) return ECF_INVALID_ARGUMENT;
  // The kernel refuses a receive into less than the message size; say so
  // plainly instead of passing on an obscure EMSGSIZE.
  if (capacity < msgSize_) return ECF_BUFFER_TOO_SMALL;
  if (hsvRC f = hsvint::faultCheck(HSV_FAULT_QUEUE_GET)) return f;
  timeoutMs = hsvint::faultWaitMs(timeoutMs);
  timespec deadline = hsvint::deadlineAfter(CLOCK_REALTIME, timeoutMs);
  for (;;) {
    ssize_t n = timeoutMs < 0
                    ? mq_receive(fd_, static_cast<char*>(buf), capacity, nullptr)
                    : mq_timedreceive(fd_, static_cast<char*>(buf), capacity, nullptr, &deadline);
    if (n >= 0) {
      if (outLen) *outLen = static_cast<size_t>(n);
      return ECF_OK;
    }
    if (errno == EINTR) continue;
    if (errno == ETIMEDOUT) return ECF_TIMEOUT;
    if (errno == EMSGSIZE) return ECF_BUFFER_TOO_SMALL;
    return hsvErrnoToECF(errno);
  }
}

bool HSVHIPCQueue::hasMessage() {
  if (fd_ < 0) return false;
  if (hsvint::faultCheck(HSV_FAULT_QUEUE_HAS_MESSAGE) != ECF_OK) return false;
  mq_attr attr{};
  if (mq_getattr(fd_, &attr) != 0) return false;
  return attr.mq_curmsgs > 0;
}

hsvRC HSVHIPCQueue::waitForMessage(int32_t timeoutMs) {
  if (fd_ < 0) return ECF_NOT_ATTACHED;
  if (hsvRC f = hsvint::faultCheck(HSV_FAULT_QUEUE_WAIT)) return f;
  timeoutMs = hsvint::faultWaitMs(timeoutMs);
  timespec deadline = hsvint::deadlineAfter(CLOCK_MONOTONIC, timeoutMs);
  for (;;) {
    pollfd p{};
    p.fd = fd_;
    p.events = POLLIN;
    int wait = -1;
    if (timeoutMs >= 0) {
      int64_t left = hsvint::msUntil(CLOCK_MONOTONIC, deadline);
      wait = left > INT32_MAX ? INT32_MAX : static_cast<int>(left);
    }
    int rc = poll(&p, 1, wait);
    if (rc > 0) {
      if (p.revents & POLLIN) return ECF_OK;
      return ECF_SYSTEM_ERROR;
    }
    if (rc == 0) {
      if (timeoutMs >= 0 && hsvint::msUntil(CLOCK_MONOTONIC, deadline) == 0) return ECF_TIMEOUT;
      continue;
    }
    if (errno != EINTR) return hsvErrnoToECF(errno);
  }
}
