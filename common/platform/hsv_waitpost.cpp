// Wait/post object: a process-local auto-reset event. A post is remembered
// until one wait consumes it, so a post that comes before the wait is not
// lost.
#include <pthread.h>

#include <cerrno>
#include <new>

#include "common/platform/hsv.h"
#include "common/platform/hsv_internal.h"

struct HSVHIPCWaitpost::Impl {
  pthread_mutex_t mutex;
  pthread_cond_t cond;      // signalled by post
  pthread_cond_t drained;   // signalled when the last waiter leaves a destroyed object
  bool posted = false;
  bool closing = false;
  int waiters = 0;
};

HSVHIPCWaitpost::HSVHIPCWaitpost() = default;

HSVHIPCWaitpost::~HSVHIPCWaitpost() { destroy(); }

hsvRC HSVHIPCWaitpost::create(int /*option*/) {
  if (impl_) return ECF_ALREADY_EXISTS;
  Impl* im = new (std::nothrow) Impl;
  if (!im) return ECF_NO_MEMORY;
  pthread_condattr_t ca;
  pthread_condattr_init(&ca);
  // Time-outs run on the monotonic clock: a clock change must not stretch
  // or cut a wait.
  pthread_condattr_setclock(&ca, CLOCK_MONOTONIC);
  int rc = pthread_mutex_init(&im->mutex, nullptr);
  if (rc == 0) {
    rc = pthread_cond_init(&im->cond, &ca);
    if (rc == 0) {
      rc = pthread_cond_init(&im->drained, &ca);
      if (rc != 0) pthread_cond_destroy(&im->cond);
    }
    if (rc != 0) pthread_mutex_destroy(&im->mutex);
  }
  pthread_condattr_destroy(&ca);
  if (rc != 0) {
    delete im;
    return hsvErrnoToECF(rc);
  }
  __atomic_store_n(&impl_, im, __ATOMIC_RELEASE);
  return ECF_OK;
}

hsvRC HSVHIPCWaitpost::wait(int32_t timeMs) {
  Impl* im = __atomic_load_n(&impl_, __ATOMIC_ACQUIRE);
  if (!im) return ECF_WAITPOST_NOT_INITIALIZED;
  timespec deadline = hsvint::deadlineAfter(CLOCK_MONOTONIC, timeMs);
  pthread_mutex_lock(&im->mutex);
  ++im->waiters;
  hsvRC result = ECF_OK;
  for (;;) {
    if (im->closing) {
      result = ECF_WAITPOST_NOT_INITIALIZED;
      break;
    }
    if (im->posted) {
      im->posted = false;
      break;
    }
    if (timeMs == 0) {
      result = ECF_TIMEOUT;
      break;
    }
    int rc = timeMs < 0 ? pthread_cond_wait(&im->cond, &im->mutex)
                        : pthread_cond_timedwait(&im->cond, &im->mutex, &deadline);
    if (rc == ETIMEDOUT) {
      // A post may have come in together with the time-out: take it.
      if (im->posted && !im->closing) {
        im->posted = false;
      } else {
        result = im->closing ? ECF_WAITPOST_NOT_INITIALIZED : ECF_TIMEOUT;
      }
      break;
    }
  }
  if (--im->waiters == 0 && im->closing) pthread_cond_signal(&im->drained);
  pthread_mutex_unlock(&im->mutex);
  return result;
}

hsvRC HSVHIPCWaitpost::post() {
  Impl* im = __atomic_load_n(&impl_, __ATOMIC_ACQUIRE);
  if (!im) return ECF_WAITPOST_NOT_INITIALIZED;
  pthread_mutex_lock(&im->mutex);
  im->posted = true;
  pthread_cond_signal(&im->cond);
  pthread_mutex_unlock(&im->mutex);
  return ECF_OK;
}

hsvRC HSVHIPCWaitpost::destroy() {
  Impl* im = __atomic_exchange_n(&impl_, static_cast<Impl*>(nullptr), __ATOMIC_ACQ_REL);
  if (!im) return ECF_WAITPOST_NOT_INITIALIZED;
  // Wake every waiter and let it leave before the object goes away, so no
  // thread is left blocked on freed memory. New calls already see no object.
  pthread_mutex_lock(&im->mutex);
  im->closing = true;
  pthread_cond_broadcast(&im->cond);
  while (im->waiters > 0) pthread_cond_wait(&im->drained, &im->mutex);
  pthread_mutex_unlock(&im->mutex);
  pthread_cond_destroy(&im->drained);
  pthread_cond_destroy(&im->cond);
  pthread_mutex_destroy(&im->mutex);
  delete im;
  return ECF_OK;
}
