// The intrusive, optionally locked, doubly linked list under every collection
// of the run-time. Orientation: olHead -> olePrev -> ... -> olTail and
// olTail -> oleNext -> ... -> olHead.
#pragma once

#include <pthread.h>

#include <atomic>
#include <cstdint>
#include <cstring>

class OrdList;
class klpThread;

// Header at the start of every object that can be put on a list.
struct OrdListElement {
  char eyeCatcher[16];
  uint64_t size;
  OrdList* oleAnchor;        // list the element is on; null when on none
  OrdListElement* olePrev;   // neighbour on the tail side; null for the tail
  OrdListElement* oleNext;   // neighbour on the head side; null for the head
  int32_t withdrawn;         // non-zero: browse operations pass over it
  void* object;

  OrdListElement() { initElement("KlpOLE:"); }
  void initElement(const char* eye) {
    memset(this, 0, sizeof(OrdListElement));
    strncpy(eyeCatcher, eye, sizeof(eyeCatcher) - 1);
    size = 64;
  }
};

// The lock shared by OrdList and Queue: a mutex that its holding thread may
// take again (depth counts the nesting), with or without owner checking.
// With owner checking on, a release by any other thread is refused.
// Ownership is decided by the OS thread, so that threads without a klpThread
// are told apart too; `owner` keeps the klpThread for messages and prints.
// The fields other threads may look at while one thread holds the lock (for
// the refusal message) are atomics.
//
// While a thread holds any of these locks it cannot be cancelled (a stop
// must leave every lock as it was), and each thread keeps the locks it holds
// so that a return to its recovery point can give them up: the jump out of a
// signal handler abandons whatever operation held them.
struct klpOwnedLock {
  std::atomic<int32_t> depth{0};
  pthread_mutex_t mutex;
  std::atomic<klpThread*> owner{nullptr};
  std::atomic<int32_t> lastError{0};
  int32_t ownerCheck = 1;
  std::atomic<unsigned long> holder{0};  // pthread_self() of the holder; 0: none

  klpOwnedLock();
  ~klpOwnedLock();
  klpOwnedLock(const klpOwnedLock&) = delete;
  klpOwnedLock& operator=(const klpOwnedLock&) = delete;

  // 0, or the system error number of a failed enter.
  int lock();
  // 0, or 1005 (message 624) when the caller does not hold the lock and
  // owner checking is on. `what` names the structure in the message.
  int unlock(const char* what);
};

// Gives up every klpOwnedLock the calling thread still holds, whatever its
// nesting. For a thread that came back to its recovery point, or ends from
// a signal handler, out of the middle of a locked operation.
void klpReleaseHeldLocks();

class OrdList {
 public:
  char qName[16];
  int32_t count;
  OrdListElement* olTail;  // written with atomic stores: read unlocked by the
  OrdListElement* olHead;  // pre-checks of getHead, browseHead, ...
  void* reserved;
  int32_t locked;   // 1: every operation takes the lock
  OrdList* self;    // own address once made ready for locking
  klpOwnedLock lk;  // depth, critical section, owner, last error, owner check

  OrdList();  // empty, "KlpList", unlocked, owner check 1
  explicit OrdList(const char* name);
  ~OrdList();  // unlinks what is left, name -> "DEL..."
  OrdList(const OrdList&) = delete;
  OrdList& operator=(const OrdList&) = delete;

  // Makes the list shared between threads: name, locked 1, self, owner check.
  void makeShared(const char* name, int ownerCheck);
  void setName(const char* name);  // at most 15 characters kept

  int putTail(OrdListElement* e);  // 0 or 1005
  int putHead(OrdListElement* e);  // 0 or 1005
  OrdListElement* getHead();
  OrdListElement* getTail();
  // First element not withdrawn, from the head (then browsePrev) or from the
  // tail (then browseNext).
  OrdListElement* browseHead();
  OrdListElement* browseTail();
  static OrdListElement* browsePrev(OrdListElement* e);
  static OrdListElement* browseNext(OrdListElement* e);
  // Removes and frees every element (operator delete of the header; the
  // elements' own clean-up does not run).
  void delList();
  void print();
  static void print(OrdListElement* e);

  // The list's lock for callers that walk it themselves (the command engine).
  // 0 / system error; unlockList answers 1005 when the caller does not hold it.
  int lockList();
  int unlockList();

  int32_t depth() const { return lk.depth; }
  klpThread* owner() const { return lk.owner; }
  int32_t lastError() const { return lk.lastError; }
  int32_t ownerCheck() const { return lk.ownerCheck; }

  // Fatal when the list is not sound (self pointer of a locked list).
  void check(const char* where) const;
 private:
  OrdListElement* takeEnd(bool fromHead, const char* where);
};

// Removes the element from its list wherever it stands. 0 or 1005; message
// 8000 when the chain is broken around it (unlinking still goes on).
int ordListDeChain(OrdListElement* e);

// Fatal error: a structure was found damaged. Prints the diagnostics on
// standard output and ends the process (SIGABRT, not recoverable).
[[noreturn]] void klpFatalStructure(const char* where, const char* what, const void* addr,
                                    const char* expected, const char* found);
// Fatal unless the element's eye-catcher is a readable, NUL-ended text.
void ordListCheckElement(const OrdListElement* e, const char* where);
