// Byte locks: one byte in shared memory, taken by an atomic exchange. The
// holder may be another process, so no OS object can be involved.
#include <sched.h>

#include <ctime>

#include "common/platform/hsv.h"

uint8_t hsvByteLockExchange(volatile uint8_t* lock) {
  return __atomic_exchange_n(lock, static_cast<uint8_t>(1), __ATOMIC_ACQUIRE);
}

void hsvByteLockConflict(volatile uint8_t* lock) {
  // Holders keep the lock briefly: yield first, then back off with short
  // sleeps so that a holder descheduled on a busy machine can finish.
  constexpr unsigned kYields = 64;
  for (unsigned attempt = 0;; ++attempt) {
    if (__atomic_load_n(lock, __ATOMIC_RELAXED) == 0 && hsvByteLockExchange(lock) == 0) return;
    if (attempt < kYields) {
      sched_yield();
    } else {
      timespec ts{0, attempt < 1024 ? 50000L : 1000000L};
      nanosleep(&ts, nullptr);
    }
  }
}

void hsvByteLockRelease(volatile uint8_t* lock) {
  __atomic_store_n(lock, static_cast<uint8_t>(0), __ATOMIC_RELEASE);
}
