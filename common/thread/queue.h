// Locked producer/consumer queue with a wait/post object: producers put at the
// head, the tail or in priority order and post only when a consumer waits;
// consumers take from the head or the tail, waiting up to a time limit while
// the queue is empty. Keeps wake-up and time-out statistics.
//
// Queue elements are OrdListElement headers (an object that begins with one,
// e.g. `struct X { OrdListElement ole; ... }`, is put as &x->ole). While on a
// queue, olePrev links toward the tail and oleNext toward the head; the
// element's oleAnchor stays null (a queue is not an OrdList). Priority puts
// need a QueueElement, and a queue that takes priority puts must hold
// QueueElements only.
#pragma once

#include <cstdint>

#include "common/platform/hsv.h"
#include "common/thread/ordlist.h"

struct QueueElement {
  OrdListElement ole;
  int32_t priority = 0;  // ascending from the head
};

class Queue {
 public:
  int32_t count = 0;
  OrdListElement* tail = nullptr;
  OrdListElement* head = nullptr;
  Queue* self = nullptr;
  klpOwnedLock lk;  // depth, critical section, owner, last error, owner check 1
  int32_t waiters = 0;
  int32_t immediateTakes = 0;
  int32_t idlePosts = 0;
  int32_t wakeups = 0;
  int32_t wakeupTime = 0;   // ms
  int32_t timeouts = 0;
  int32_t timeoutTime = 0;  // ms
  double avgWakeup = 0.0;
  double avgTimeout = 0.0;
  HSVHIPCWaitpost waitpost;
  hsvRC createRc = 0;  // result of creating the wait/post object

  Queue();
  ~Queue();  // elements still queued stay allocated (the owner drains first)
  Queue(const Queue&) = delete;
  Queue& operator=(const Queue&) = delete;

  int putTailAndNotify(OrdListElement* e);                // 0
  int putHeadAndNotify(OrdListElement* e);                // 0
  int putHeadWithPriorityAndNotify(QueueElement* e);      // 0
  // Waits up to *waitMs while empty (<= 0: no wait), then takes an element;
  // null when still empty. *waitMs receives the time waited.
  OrdListElement* getHeadWithWait(int32_t* waitMs);
  OrdListElement* getTailWithWait(int32_t* waitMs);
  // Posts the wait/post object when a consumer waits, else counts an idle post.
  void notify();
  // Computes the whole-number averages and prints the statistics line.
  void printStats();
  int32_t getCount();

 private:
  void waitStep(int32_t* waitMs);
  OrdListElement* take(bool fromHead);
};
