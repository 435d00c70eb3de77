#include "common/thread/queue.h"

#include <cstdio>

#include "common/util/klprc.h"

namespace {

const char* waitErrorName(hsvRC rc) {
  switch (rc) {
    case ECF_WAITPOST_RESET: return "ECF_WAITPOST_RESET";
    case ECF_WAITPOST_NOT_POSTED: return "ECF_WAITPOST_NOT_POSTED";
    case ECF_WAITPOST_NOT_INITIALIZED: return "ECF_WAITPOST_NOT_INITIALIZED";
    case ECF_INVALID_VERSION: return "ECF_INVALID_VERSION";
    case ECF_SEM_WAIT_ABANDONED: return "ECF_SEM_WAIT_ABANDONED";
    case ECF_ACCESS_DENIED: return "ECF_ACCESS_DENIED";
    case ECF_DEADLOCK: return "ECF_DEADLOCK";
    default: return "unknown Error";
  }
}

int32_t elapsedMs(const HSVTimeUTC& from, const HSVTimeUTC& to) {
  int64_t secs = to.seconds - from.seconds;
  int64_t ms = to.microseconds / 1000 - from.microseconds / 1000;
  if (secs >= 1) ms += secs * 1000;
  return static_cast<int32_t>(ms);
}

}  // namespace

Queue::Queue() {
  self = this;
  lk.ownerCheck = 1;
  createRc = waitpost.create(HSV_CREATE_OPTION);
  if (createRc != 0) {
    printf("unknown wait/post create error\n");
    fflush(stdout);
  }
}

Queue::~Queue() {
  waitpost.destroy();
  self = nullptr;
}

int32_t Queue::getCount() {
  lk.lock();
  int32_t n = count;
  lk.unlock("Queue");
  return n;
}

int Queue::putTailAndNotify(OrdListElement* e) {
  lk.lock();
  e->olePrev = nullptr;
  e->oleNext = tail;
  if (tail != nullptr) tail->olePrev = e;
  tail = e;
  if (head == nullptr) head = e;
  ++count;
  lk.unlock("Queue");
  notify();
  return 0;
}

int Queue::putHeadAndNotify(OrdListElement* e) {
  lk.lock();
  e->oleNext = nullptr;
  e->olePrev = head;
  if (head != nullptr) head->oleNext = e;
  head = e;
  if (tail == nullptr) tail = e;
  ++count;
  lk.unlock("Queue");
  notify();
  return 0;
}

int Queue::putHeadWithPriorityAndNotify(QueueElement* qe) {
  OrdListElement* e = &qe->ole;
  lk.lock();
  OrdListElement* p = head;
  while (p != nullptr && reinterpret_cast<QueueElement*>(p)->priority < qe->priority)
    p = p->olePrev;
  if (p == nullptr) {  // every element ranks lower: new tail
    e->olePrev = nullptr;
    e->oleNext = tail;
    if (tail != nullptr) tail->olePrev = e;
    tail = e;
    if (head == nullptr) head = e;
  } else {  // on the head side of p
    e->olePrev = p;
    e->oleNext = p->oleNext;
    if (p->oleNext != nullptr)
      p->oleNext->olePrev = e;
    else
      head = e;
    p->oleNext = e;
  }
  ++count;
  lk.unlock("Queue");
  notify();
  return 0;
}

void Queue::notify() {
  lk.lock();
  if (waiters == 0) {
    ++idlePosts;
    lk.unlock("Queue");
    return;
  }
  lk.unlock("Queue");
  hsvRC rc = waitpost.post();
  if (rc != 0) {
    if (rc == ECF_WAITPOST_NOT_INITIALIZED)
      printf("Post WAITPOST_NOT_INITIALIZED\n");
    else
      printf("unknown Post error\n");
    fflush(stdout);
  }
}

namespace {

// Counts a waiter off again however its wait ends, also when the waiting
// thread is cancelled: a stop must leave the queue's counts as they were.
struct WaiterCount {
  Queue* q;
  bool counted = true;
  ~WaiterCount() {
    if (!counted) return;
    q->lk.lock();
    --q->waiters;
    q->lk.unlock("Queue");
  }
};

}  // namespace

void Queue::waitStep(int32_t* waitMs) {
  if (*waitMs <= 0) {
    *waitMs = 0;
    return;
  }
  lk.lock();
  if (count != 0) {
    ++immediateTakes;
    *waitMs = 0;
    lk.unlock("Queue");
    return;
  }
  ++waiters;
  lk.unlock("Queue");
  WaiterCount waiter{this};
  HSVTimeUTC before = hsvTimeGetUTC();
  int32_t elapsed = 0;
  for (;;) {
    hsvRC rc = waitpost.wait(*waitMs > elapsed ? *waitMs - elapsed : 0);
    int kind = 0;  // 1 wakeup, 2 timeout, 0 error
    if (rc == 0) {
      kind = 1;
    } else if (rc == ECF_TIMEOUT) {
      kind = 2;
    } else {
      printf("Error from HSVHIPCWaitpost::wait %d: %s\n", static_cast<int>(rc),
             waitErrorName(rc));
      fflush(stdout);
    }
    lk.lock();
    elapsed = elapsedMs(before, hsvTimeGetUTC());
    // A post whose element another consumer took first, or one left over
    // from a waiter that timed out as it came, is no reason to give up
    // while time is left: the queue itself decides.
    if (kind == 1 && count == 0 && elapsed < *waitMs) {
      lk.unlock("Queue");
      continue;
    }
    --waiters;
    waiter.counted = false;
    if (kind == 1) {
      ++wakeups;
      wakeupTime += elapsed;
    } else if (kind == 2) {
      ++timeouts;
      timeoutTime += elapsed;
    }
    lk.unlock("Queue");
    break;
  }
  *waitMs = elapsed;
}

OrdListElement* Queue::take(bool fromHead) {
  lk.lock();
  OrdListElement* e = nullptr;
  if (count > 0) {
    if (fromHead) {
      e = head;
      head = e->olePrev;
      if (head != nullptr)
        head->oleNext = nullptr;
      else
        tail = nullptr;
    } else {
      e = tail;
      tail = e->oleNext;
      if (tail != nullptr)
        tail->olePrev = nullptr;
      else
        head = nullptr;
    }
    --count;
    e->olePrev = nullptr;
    e->oleNext = nullptr;
  }
  lk.unlock("Queue");
  return e;
}

OrdListElement* Queue::getHeadWithWait(int32_t* waitMs) {
  int32_t none = 0;
  if (waitMs == nullptr) waitMs = &none;
  waitStep(waitMs);
  return take(true);
}

OrdListElement* Queue::getTailWithWait(int32_t* waitMs) {
  int32_t none = 0;
  if (waitMs == nullptr) waitMs = &none;
  waitStep(waitMs);
  return take(false);
}

void Queue::printStats() {
  lk.lock();
  // Whole-number averages: the remainder is dropped before the result
  // becomes a double.
  if (wakeups >= 1) avgWakeup = static_cast<double>(wakeupTime / wakeups);
  if (timeouts >= 1) avgTimeout = static_cast<double>(timeoutTime / timeouts);
  printf("<=== wakeup stats: %ld / %ld = %5.5f, timeout stats:     %ld / %ld = %5.5f ===>\n",
         static_cast<long>(wakeupTime), static_cast<long>(wakeups), avgWakeup,
         static_cast<long>(timeoutTime), static_cast<long>(timeouts), avgTimeout);
  fflush(stdout);
  lk.unlock("Queue");
}
