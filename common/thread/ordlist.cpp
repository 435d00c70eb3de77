#include "common/thread/ordlist.h"

#include <cctype>
#include <cinttypes>
#include <csignal>
#include <cstdio>
#include <cstdlib>

#include "common/msg/klplog.h"
#include "common/thread/klpthread.h"
#include "common/trace/trace.h"
#include "common/util/klprc.h"

namespace {

// The unlocked pre-checks read head and tail while another thread may be
// changing them under the lock.
inline OrdListElement* loadLink(OrdListElement* const* p) {
  return __atomic_load_n(p, __ATOMIC_ACQUIRE);
}
inline void storeLink(OrdListElement** p, OrdListElement* v) {
  __atomic_store_n(p, v, __ATOMIC_RELEASE);
}

unsigned long selfId() { return static_cast<unsigned long>(pthread_self()); }

// "%s:0x%08x" of a thread, or "UNKNOWN".
void threadLabel(klpThread* t, char* buf, size_t len) {
  if (t == nullptr) {
    snprintf(buf, len, "UNKNOWN");
    return;
  }
  snprintf(buf, len, "%s:0x%08x", t->name,
           static_cast<unsigned>(reinterpret_cast<uintptr_t>(t) & 0xFFFFFFFFu));
}

}  // namespace

// ---------------------------------------------------------------------------
// Fatal structure checks
// ---------------------------------------------------------------------------
void klpFatalStructure(const char* where, const char* what, const void* addr,
                       const char* expected, const char* found) {
  char shown[17];
  size_t i = 0;
  for (; i < 16 && found != nullptr && found[i] != '\0'; ++i)
    shown[i] = isprint(static_cast<unsigned char>(found[i])) ? found[i] : '.';
  shown[i] = '\0';
  printf("KLP fatal error in %s: %s at 0x%016" PRIxPTR " is damaged\n", where ? where : "?",
         what ? what : "structure", reinterpret_cast<uintptr_t>(addr));
  printf(" expected \"%s\", found \"%s\"\n", expected ? expected : "", shown);
  fflush(stdout);
  // A damaged structure cannot be recovered from: make sure the recovery
  // handler does not catch the abort.
  signal(SIGABRT, SIG_DFL);
  abort();
}

void ordListCheckElement(const OrdListElement* e, const char* where) {
  if (e == nullptr) return;
  const char* eye = e->eyeCatcher;
  bool ok = isalpha(static_cast<unsigned char>(eye[0])) != 0;
  size_t n = 0;
  while (ok && n < sizeof(e->eyeCatcher) && eye[n] != '\0') {
    if (!isprint(static_cast<unsigned char>(eye[n]))) ok = false;
    ++n;
  }
  if (n == sizeof(e->eyeCatcher)) ok = false;  // not NUL-terminated
  if (!ok) klpFatalStructure(where, "list element", e, "a readable eye-catcher", eye);
}

// ---------------------------------------------------------------------------
// The owned lock
// ---------------------------------------------------------------------------
namespace {

// The locks the calling thread holds, in the order taken. A thread holds
// few at a time (the engine two); one beyond the table is still a lock, it
// only cannot be given up by klpReleaseHeldLocks.
constexpr int kHeldMax = 8;
struct HeldLocks {
  klpOwnedLock* locks[kHeldMax];
  int count;
  int cancelState;  // before the first lock was taken
};
thread_local HeldLocks tlsHeld;

void noteTaken(klpOwnedLock* l) {
  HeldLocks& h = tlsHeld;
  if (h.count == 0) pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, &h.cancelState);
  if (h.count < kHeldMax) h.locks[h.count] = l;
  ++h.count;
}

void noteReleased(klpOwnedLock* l) {
  HeldLocks& h = tlsHeld;
  int n = h.count < kHeldMax ? h.count : kHeldMax;
  for (int i = n - 1; i >= 0; --i) {
    if (h.locks[i] != l) continue;
    for (int j = i; j + 1 < n; ++j) h.locks[j] = h.locks[j + 1];
    break;
  }
  if (h.count > 0 && --h.count == 0) pthread_setcancelstate(h.cancelState, nullptr);
}

}  // namespace

klpOwnedLock::klpOwnedLock() { pthread_mutex_init(&mutex, nullptr); }
klpOwnedLock::~klpOwnedLock() { pthread_mutex_destroy(&mutex); }

int klpOwnedLock::lock() {
  lastError.store(0, std::memory_order_relaxed);
  if (holder.load(std::memory_order_relaxed) == selfId()) {
    depth.fetch_add(1, std::memory_order_relaxed);
    return 0;
  }
  int rc = pthread_mutex_lock(&mutex);
  if (rc != 0) {
    lastError.store(rc, std::memory_order_relaxed);
    return rc;
  }
  noteTaken(this);
  depth.fetch_add(1, std::memory_order_relaxed);
  holder.store(selfId(), std::memory_order_relaxed);
  // The thread-id list runs without owner checking: looking up the owner
  // would take that very list.
  if (ownerCheck) owner.store(currentThread(), std::memory_order_relaxed);
  return 0;
}

int klpOwnedLock::unlock(const char* what) {
  lastError.store(0, std::memory_order_relaxed);
  if (ownerCheck && holder.load(std::memory_order_relaxed) != selfId()) {
    char caller[48], holderText[48], err[16], dep[16];
    threadLabel(currentThread(), caller, sizeof caller);
    threadLabel(owner.load(std::memory_order_relaxed), holderText, sizeof holderText);
    snprintf(err, sizeof err, "%d", lastError.load(std::memory_order_relaxed));
    snprintf(dep, sizeof dep, "%d", depth.load(std::memory_order_relaxed));
    logKlpMsg(624, "OrdList::unlock", KLP_DEST_SEVERITY, caller, nullptr, 5, what ? what : "",
              err, "Thread does not hold lock", holderText, dep);
    return KLP_RC_NOT_LOCK_OWNER;
  }
  if (depth.fetch_sub(1, std::memory_order_relaxed) - 1 <= 0) {
    depth.store(0, std::memory_order_relaxed);
    owner.store(nullptr, std::memory_order_relaxed);
    bool mine = holder.load(std::memory_order_relaxed) == selfId();
    holder.store(0, std::memory_order_relaxed);
    pthread_mutex_unlock(&mutex);
    if (mine) noteReleased(this);
  }
  return 0;
}

void klpReleaseHeldLocks() {
  HeldLocks& h = tlsHeld;
  while (h.count > 0 && h.count <= kHeldMax) {
    klpOwnedLock* l = h.locks[h.count - 1];
    if (l->holder.load(std::memory_order_relaxed) != selfId()) {
      noteReleased(l);
      continue;
    }
    l->depth.store(1, std::memory_order_relaxed);
    l->unlock("klpReleaseHeldLocks");
  }
  if (h.count > 0) {  // more than the table kept: forgotten, cancellable again
    h.count = 0;
    pthread_setcancelstate(h.cancelState, nullptr);
  }
}

// ---------------------------------------------------------------------------
// OrdList
// ---------------------------------------------------------------------------
OrdList::OrdList() : OrdList("KlpList") {}

OrdList::OrdList(const char* name)
    : count(0), olTail(nullptr), olHead(nullptr), reserved(nullptr), locked(0), self(nullptr) {
  memset(qName, 0, sizeof qName);
  setName(name);
  lk.ownerCheck = 1;
}

OrdList::~OrdList() {
  // Former elements stay allocated, but must no longer point at us.
  OrdListElement* e = olTail;
  while (e != nullptr) {
    OrdListElement* next = e->oleNext;
    e->oleAnchor = nullptr;
    e->olePrev = nullptr;
    e->oleNext = nullptr;
    e = next;
  }
  storeLink(&olTail, nullptr);
  storeLink(&olHead, nullptr);
  count = 0;
  memcpy(qName, "DEL", 3);
  self = nullptr;
  lk.owner.store(nullptr);
  lk.depth.store(0);
  lk.lastError.store(0);
  lk.ownerCheck = 0;
}

void OrdList::setName(const char* name) {
  memset(qName, 0, sizeof qName);
  if (name != nullptr) strncpy(qName, name, sizeof qName - 1);
}

void OrdList::makeShared(const char* name, int ownerCheck) {
  if (name != nullptr) setName(name);
  lk.ownerCheck = ownerCheck ? 1 : 0;
  self = this;
  locked = 1;
}

void OrdList::check(const char* where) const {
  if (locked && self != this) klpFatalStructure(where, "OrdList", this, "self pointer", qName);
}

int OrdList::lockList() { return locked ? lk.lock() : 0; }
int OrdList::unlockList() { return locked ? lk.unlock(qName) : 0; }

int OrdList::putTail(OrdListElement* e) {
  check("OrdList::putTail");
  ordListCheckElement(e, "OrdList::putTail");
  if (e == nullptr || e->oleAnchor != nullptr) return KLP_RC_BAD_PARM;  // already on a list
  e->olePrev = nullptr;
  int rc = lockList();
  if (rc != 0) return rc;
  e->oleNext = olTail;
  if (olTail != nullptr) olTail->olePrev = e;
  storeLink(&olTail, e);
  if (olHead == nullptr) storeLink(&olHead, e);
  e->oleAnchor = this;
  ++count;
  return unlockList();
}

int OrdList::putHead(OrdListElement* e) {
  check("OrdList::putHead");
  ordListCheckElement(e, "OrdList::putHead");
  if (e == nullptr || e->oleAnchor != nullptr) return KLP_RC_BAD_PARM;
  e->oleNext = nullptr;
  int rc = lockList();
  if (rc != 0) return rc;
  e->olePrev = olHead;
  if (olHead != nullptr) olHead->oleNext = e;
  storeLink(&olHead, e);
  if (olTail == nullptr) storeLink(&olTail, e);
  e->oleAnchor = this;
  ++count;
  return unlockList();
}

// Takes the element at one end: the head (whose head-side neighbour is
// null) or the tail (whose tail-side neighbour is null).
OrdListElement* OrdList::takeEnd(bool fromHead, const char* where) {
  OrdListElement** end = fromHead ? &olHead : &olTail;
  OrdListElement** other = fromHead ? &olTail : &olHead;
  if (loadLink(end) == nullptr) return nullptr;
  check(where);
  if (lockList() != 0) return nullptr;
  OrdListElement* e = *end;
  if (e != nullptr) {
    OrdListElement* inward = fromHead ? e->olePrev : e->oleNext;
    storeLink(end, inward);
    if (inward != nullptr)
      (fromHead ? inward->oleNext : inward->olePrev) = nullptr;
    else
      storeLink(other, nullptr);
    --count;
    e->oleAnchor = nullptr;
    e->olePrev = nullptr;
    e->oleNext = nullptr;
  }
  unlockList();
  return e;
}

OrdListElement* OrdList::getHead() { return takeEnd(true, "OrdList::getHead"); }

OrdListElement* OrdList::getTail() { return takeEnd(false, "OrdList::getTail"); }

OrdListElement* OrdList::browseHead() {
  if (loadLink(&olHead) == nullptr) return nullptr;
  check("OrdList::browseHead");
  if (lockList() != 0) return nullptr;
  OrdListElement* e = olHead;
  while (e != nullptr && e->withdrawn) e = e->olePrev;
  unlockList();
  return e;
}

OrdListElement* OrdList::browseTail() {
  if (loadLink(&olTail) == nullptr) return nullptr;
  check("OrdList::browseTail");
  if (lockList() != 0) return nullptr;
  OrdListElement* e = olTail;
  while (e != nullptr && e->withdrawn) e = e->oleNext;
  unlockList();
  return e;
}

OrdListElement* OrdList::browsePrev(OrdListElement* e) {
  if (e == nullptr || e->oleAnchor == nullptr) return nullptr;
  OrdList* list = e->oleAnchor;
  list->check("OrdList::browsePrev");
  if (list->lockList() != 0) return nullptr;
  OrdListElement* p = e->olePrev;
  while (p != nullptr && p->withdrawn) p = p->olePrev;
  list->unlockList();
  return p;
}

OrdListElement* OrdList::browseNext(OrdListElement* e) {
  if (e == nullptr || e->oleAnchor == nullptr) return nullptr;
  OrdList* list = e->oleAnchor;
  list->check("OrdList::browseNext");
  if (list->lockList() != 0) return nullptr;
  OrdListElement* p = e->oleNext;
  while (p != nullptr && p->withdrawn) p = p->oleNext;
  list->unlockList();
  return p;
}

void OrdList::delList() {
  if (loadLink(&olTail) == nullptr) return;
  check("OrdList::delList");
  if (lockList() != 0) return;
  OrdListElement* e = olTail;
  while (e != nullptr) {
    OrdListElement* next = e->oleNext;
    storeLink(&olTail, next);
    --count;
    ::operator delete(static_cast<void*>(e));
    e = next;
  }
  storeLink(&olHead, nullptr);
  if (count < 0) count = 0;
  unlockList();
}

void OrdList::print() {
  printf("OrdList:print entered for list %s\n", qName);
  printf(" list Addr=%.*" PRIXPTR "\n", 16, reinterpret_cast<uintptr_t>(this));
  printf(" qName=%s\n", qName);
  printf(" olTail=%.*" PRIXPTR "\n", 16, reinterpret_cast<uintptr_t>(loadLink(&olTail)));
  printf(" olHead=%.*" PRIXPTR "\n", 16, reinterpret_cast<uintptr_t>(loadLink(&olHead)));
  printf("OrdList:print exit for list %s\n", qName);
  fflush(stdout);
}

void OrdList::print(OrdListElement* e) {
  printf("OrdList:print entered for list entry \n");
  printf(" list Entry Addr=%.*" PRIXPTR "\n", 16, reinterpret_cast<uintptr_t>(e));
  if (e != nullptr) {
    printf(" olePrev=%.*" PRIXPTR "\n", 16, reinterpret_cast<uintptr_t>(e->olePrev));
    printf(" oleNext=%.*" PRIXPTR "\n", 16, reinterpret_cast<uintptr_t>(e->oleNext));
    printf(" oleAnchor=%.*" PRIXPTR "\n", 16, reinterpret_cast<uintptr_t>(e->oleAnchor));
    if (e->oleAnchor != nullptr) printf(" oleName=%s\n", e->oleAnchor->qName);
  }
  fflush(stdout);
}

int ordListDeChain(OrdListElement* e) {
  if (e == nullptr) return 0;
  OrdList* list = e->oleAnchor;
  if (list == nullptr) return 0;
  list->check("ordListDeChain");
  ordListCheckElement(e, "ordListDeChain");
  int rc = list->lockList();
  if (rc != 0) return rc;
  if (e->oleAnchor != list) {  // taken off by another thread meanwhile
    list->unlockList();
    return 0;
  }
  bool broken = false;
  if (e != list->olHead) {
    if (e->oleNext != nullptr)
      e->oleNext->olePrev = e->olePrev;
    else
      broken = true;
  } else {
    storeLink(&list->olHead, e->olePrev);
  }
  if (e != list->olTail) {
    if (e->olePrev != nullptr)
      e->olePrev->oleNext = e->oleNext;
    else
      broken = true;
  } else {
    storeLink(&list->olTail, e->oleNext);
  }
  if (list->count > 0) --list->count;
  e->oleAnchor = nullptr;
  e->olePrev = nullptr;
  e->oleNext = nullptr;
  char listName[sizeof list->qName];
  memcpy(listName, list->qName, sizeof listName);
  rc = list->unlockList();
  // Reported after the lock is given up: issuing a message may take other locks.
  if (broken) {
    char eye[sizeof e->eyeCatcher + 1] = {0};
    memcpy(eye, e->eyeCatcher, sizeof e->eyeCatcher);
    logKlpMsg(8000, "ordListDeChain", KLP_DEST_SEVERITY, eye, nullptr, 1, listName);
  }
  return rc;
}
