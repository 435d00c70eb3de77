// Wait/post object: a process-local event that counts its posts. A post is
// remembered until one wait consumes it, so a post that comes before the
// wait is not lost, and two posts wake two waiters even when both come
// before either waiter runs.
#include <pthread.h>

#include <cerrno>
#include <new>

#include "common/platform/hsv.h"
#include "common/platform/hsv_internal.h"

// The state is allocated by the first create and kept until the object is
// destructed: a wait or post that races with destroy then finds the object
// closed instead of freed memory.
struct HSVHIPCWaitpost::Impl : HSVHeapObject {
  pthread_mutex_t mutex;
  pthread_cond_t cond;      // signalled by post
  pthread_cond_t drained;   // signalled when the last waiter leaves a closing object
  bool live = false;        // between create and destroy
  int posts = 0;            // posts not yet consumed by a wait
  bool closing = false;
  int waiters = 0;
};

HSVHIPCWaitpost::HSVHIPCWaitpost() = default;

HSVHIPCWaitpost::~HSVHIPCWaitpost() {
  destroy();
  if (Impl* im = impl_) {
    pthread_cond_destroy(&im->drained);
    pthread_cond_destroy(&im->cond);
    pthread_mutex_destroy(&im->mutex);
    delete im;
  }
}

namespace {

int initImpl(pthread_mutex_t* mutex, pthread_cond_t* cond, pthread_cond_t* drained) {
  pthread_condattr_t ca;
  pthread_condattr_init(&ca);
  // Time-outs run on the monotonic clock: a clock change must not stretch
  // or cut a wait.
  pthread_condattr_setclock(&ca, CLOCK_MONOTONIC);
  int rc = pthread_mutex_init(mutex, nullptr);
  if (rc == 0) {
    rc = pthread_cond_init(cond, &ca);
    if (rc == 0) {
      rc = pthread_cond_init(drained, &ca);
      if (rc != 0) pthread_cond_destroy(cond);
    }
    if (rc != 0) pthread_mutex_destroy(mutex);
  }
  pthread_condattr_destroy(&ca);
  return rc;
}

}  // namespace

hsvRC HSVHIPCWaitpost::create(int /*option*/) {
  if (hsvRC f = hsvint::faultCheck(HSV_FAULT_WAITPOST_CREATE)) return f;
  Impl* im = __atomic_load_n(&impl_, __ATOMIC_ACQUIRE);
  if (!im) {
    im = new (std::nothrow) Impl;
    if (!im) return ECF_NO_MEMORY;
    int rc = initImpl(&im->mutex, &im->cond, &im->drained);
    if (rc != 0) {
      delete im;
      return hsvErrnoToECF(rc);
    }
    __atomic_store_n(&impl_, im, __ATOMIC_RELEASE);
  }
  pthread_mutex_lock(&im->mutex);
  hsvRC result = im->live ? ECF_ALREADY_EXISTS : ECF_OK;
  if (!im->live) {
    im->live = true;
    im->posts = 0;
  }
  pthread_mutex_unlock(&im->mutex);
  return result;
}

namespace {

// Leaves the object as the wait found it however the wait ends, also when
// the waiting thread is cancelled inside the condition wait (the mutex is
// held again by then and the unwinding runs this).
struct WaiterGuard {
  pthread_mutex_t* mutex;
  pthread_cond_t* drained;
  int* waiters;
  const bool* closing;
  ~WaiterGuard() {
    if (--*waiters == 0 && *closing) pthread_cond_signal(drained);
    pthread_mutex_unlock(mutex);
  }
};

}  // namespace

hsvRC HSVHIPCWaitpost::wait(int32_t timeMs) {
  Impl* im = __atomic_load_n(&impl_, __ATOMIC_ACQUIRE);
  if (!im) return ECF_WAITPOST_NOT_INITIALIZED;
  if (hsvRC f = hsvint::faultCheck(HSV_FAULT_WAITPOST_WAIT)) return f;
  timespec deadline = hsvint::deadlineAfter(CLOCK_MONOTONIC, timeMs);
  pthread_mutex_lock(&im->mutex);
  if (!im->live) {
    pthread_mutex_unlock(&im->mutex);
    return ECF_WAITPOST_NOT_INITIALIZED;
  }
  ++im->waiters;
  WaiterGuard guard{&im->mutex, &im->drained, &im->waiters, &im->closing};
  for (;;) {
    if (im->closing) return ECF_WAITPOST_NOT_INITIALIZED;
    if (im->posts > 0) {
      --im->posts;
      return ECF_OK;
    }
    if (timeMs == 0) return ECF_TIMEOUT;
    int rc = timeMs < 0 ? pthread_cond_wait(&im->cond, &im->mutex)
                        : pthread_cond_timedwait(&im->cond, &im->mutex, &deadline);
    if (rc == ETIMEDOUT) {
      // A post may have come in together with the time-out: take it.
      if (im->closing) return ECF_WAITPOST_NOT_INITIALIZED;
      if (im->posts == 0) return ECF_TIMEOUT;
      --im->posts;
      return ECF_OK;
    }
  }
}

hsvRC HSVHIPCWaitpost::post() {
  Impl* im = __atomic_load_n(&impl_, __ATOMIC_ACQUIRE);
  if (!im) return ECF_WAITPOST_NOT_INITIALIZED;
  if (hsvRC f = hsvint::faultCheck(HSV_FAULT_WAITPOST_POST)) return f;
  pthread_mutex_lock(&im->mutex);
  hsvRC result = ECF_WAITPOST_NOT_INITIALIZED;
  if (im->live) {
    ++im->posts;
    pthread_cond_signal(&im->cond);
    result = ECF_OK;
  }
  pthread_mutex_unlock(&im->mutex);
  return result;
}

hsvRC HSVHIPCWaitpost::destroy() {
  Impl* im = __atomic_load_n(&impl_, __ATOMIC_ACQUIRE);
  if (!im) return ECF_WAITPOST_NOT_INITIALIZED;
  // Wake every waiter and let it leave, so no thread stays blocked on an
  // object that is gone; calls from now on find it closed.
  pthread_mutex_lock(&im->mutex);
  if (!im->live) {
    pthread_mutex_unlock(&im->mutex);
    return ECF_WAITPOST_NOT_INITIALIZED;
  }
  im->live = false;
  im->closing = true;
  pthread_cond_broadcast(&im->cond);
  while (im->waiters > 0) pthread_cond_wait(&im->drained, &im->mutex);
  im->closing = false;
  im->posts = 0;
  pthread_mutex_unlock(&im->mutex);
  return ECF_OK;
}
