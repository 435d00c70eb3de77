// Platform codes: their texts and the mapping from errno.
#include <cerrno>

#include "common/platform/hsv.h"

const char* ecfErrorGetDescription(hsvRC code) {
  switch (code) {
    case ECF_OK: return "success";
    case ECF_ACCESS_DENIED: return "access denied";
    case ECF_NOT_FOUND: return "object not found";
    case ECF_INVALID_ARGUMENT: return "invalid argument";
    case ECF_INVALID_VERSION: return "invalid version";
    case ECF_ALREADY_EXISTS: return "object already exists";
    case ECF_NOT_ATTACHED: return "object not created or attached";
    case ECF_MSG_TOO_BIG: return "message longer than the queue's maximum message size";
    case ECF_BUFFER_TOO_SMALL: return "buffer smaller than the queue's message size";
    case ECF_DEADLOCK: return "deadlock";
    case ECF_QUEUE_FULL: return "queue full";
    case ECF_INTERRUPTED: return "interrupted";
    case ECF_LIMIT_REACHED: return "system limit reached";
    case ECF_NO_MEMORY: return "not enough memory";
    case ECF_NOT_OWNED: return "object belongs to another user or is open to group or others";
    case ECF_TIMEOUT: return "time-out";
    case ECF_SEM_WAIT_ABANDONED: return "wait abandoned";
    case ECF_SYSTEM_ERROR: return "operating system error";
    case ECF_WAITPOST_NOT_INITIALIZED: return "wait/post object not initialized";
    case ECF_WAITPOST_NOT_POSTED: return "wait/post object not posted";
    case ECF_WAITPOST_RESET: return "wait/post object reset";
    default: return "unknown platform error";
  }
}

hsvRC hsvErrnoToECF(int err) {
  switch (err) {
    case 0: return ECF_OK;
    case ENOENT: return ECF_NOT_FOUND;
    case EEXIST: return ECF_ALREADY_EXISTS;
    case EACCES:
    case EPERM: return ECF_ACCESS_DENIED;
    case ENOMEM: return ECF_NO_MEMORY;
    case EMFILE:
    case ENFILE:
    case ENOSPC: return ECF_LIMIT_REACHED;
    case EMSGSIZE: return ECF_MSG_TOO_BIG;
    case EINVAL:
    case ENAMETOOLONG: return ECF_INVALID_ARGUMENT;
    case ETIMEDOUT: return ECF_TIMEOUT;
    case EINTR: return ECF_INTERRUPTED;
    case EDEADLK: return ECF_DEADLOCK;
    default: return ECF_SYSTEM_ERROR;
  }
}
