#include "common/thread/klpthread.h"

#include <sched.h>

#include <atomic>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <new>

#include "common/msg/klplog.h"
#include "common/msg/msglogger.h"
#include "common/platform/hsv.h"
#include "common/thread/threadlocal.h"
#include "common/trace/trace_anchor.h"
#include "common/util/klprc.h"

namespace {

// The start and stop points name the thread: component 11, functions
// "KlpThread::start" and "KlpThread::stop", basic data.
constexpr int kTrcCommon = 11, kTrcStart = 8, kTrcStop = 9, kTrcBasic = 2;

void traceThread(int function, const char* what, const klpThread* t) {
  trcData(kTrcCommon, function, what, kTrcBasic, TRC_OBJ_NAME,
          static_cast<uint32_t>(strnlen(t->name, sizeof t->name)), t->name);
}

thread_local klpThread* tlsThread = nullptr;
// The first prologue: 0 not yet, 1 running on some thread, 2 done.
std::atomic<int> g_firstPrologue{0};

template <typename T>
T* neverDestroyed() {
  // Process-wide objects outlive every thread: no exit-time destruction
  // while other threads may still use them.
  alignas(T) static unsigned char storage[sizeof(T)];
  static T* obj = new (storage) T();
  return obj;
}

void setWithdrawn(OrdListElement* e) {
  OrdList* list = e->oleAnchor;
  if (list != nullptr) list->lockList();
  e->withdrawn = 1;
  if (list != nullptr) list->unlockList();
}

const char* threadNameForLogger() {
  klpThread* t = currentThread();
  return t != nullptr ? t->name : "";
}

// Runs when the OS thread goes, whichever way (return, thread end,
// cancellation): its id may be handed to a new thread, so its entry must
// leave the thread-id list.
struct ThreadExitGuard {
  klpThread* t;
  ~ThreadExitGuard() {
    ordListDeChain(&t->tid);
    tlsThread = nullptr;
  }
};

void* threadTrampoline(void* arg) {
  klpThread* t = static_cast<klpThread*>(arg);
  t->threadId = hsvThreadID();
  trcSetThreadName(t->name);  // so that a formatter names the thread's records
  ThreadExitGuard guard{t};
  if (t->startRoutine != nullptr) t->startRoutine(t);
  // A body that returns without ending itself ends as with 0.
  threadEnd(t, 0);
}

const char* createErrorName(int err) {
  switch (err) {
    case 11: return "EAGAIN";
    case 22: return "EINVAL";
    case 12: return "ENOMEM";
    case 1: return "EPERM";
    default: return nullptr;
  }
}

void joinIfEnded(klpThread* t) {
  if (!t->hasHandle) return;
  if (pthread_equal(t->handle, pthread_self()))
    pthread_detach(t->handle);  // a thread cannot wait for itself
  else
    pthread_join(t->handle, nullptr);
  t->hasHandle = 0;
}

}  // namespace

klpThread* klpTlsCurrentThread() { return tlsThread; }
void klpTlsSetCurrentThread(klpThread* thread) { tlsThread = thread; }

// ---------------------------------------------------------------------------
// State texts
// ---------------------------------------------------------------------------
const char* threadStateWord(int32_t state) {
  static const char* const words[] = {"EXIST", "START", "INIT", "RUN",
                                      "REST",  "STOP",  "WAIT", "DBWAIT"};
  return (state >= 1 && state <= 8) ? words[state - 1] : "UNKNOWN";
}

const char* threadStateText(int32_t state) {
  static const char* const texts[] = {"exists",       "was started", "is initializing",
                                      "is doing work", "is resting",  "is stopped",
                                      "is waiting",    "is waiting for DB"};
  return (state >= 1 && state <= 8) ? texts[state - 1] : "is in an unknown thread state";
}

// ---------------------------------------------------------------------------
// Database connections (no database behind them)
// ---------------------------------------------------------------------------
klpDbConn::klpDbConn(char k, const char* db, int32_t cp) : kind(k), codePage(cp) {
  memset(dbName, 0, sizeof dbName);
  if (db != nullptr) strncpy(dbName, db, KLP_DB_NAME_MAX);
}
klpDbConn::~klpDbConn() = default;
int klpDbConn::interrupt() {
  __atomic_add_fetch(&interrupts, 1, __ATOMIC_RELAXED);
  return 0;
}
int klpDbConn::close() {
  isOpen = 0;
  return 0;
}
bool klpDbConn::matches(char k, const char* db, int32_t cp) const {
  return isOpen && kind == k && codePage == cp &&
         strncmp(dbName, db ? db : "", KLP_DB_NAME_MAX) == 0;
}

void klpDbCtx::init() {
  ole.initElement("KlpCtxE");
  memset(dbAlias, ' ', KLP_DB_NAME_MAX);
  dbAlias[KLP_DB_NAME_MAX] = '\0';
  interrupts = 0;
}
int klpDbCtx::interrupt() {
  __atomic_add_fetch(&interrupts, 1, __ATOMIC_RELAXED);
  return 0;
}

namespace {
struct ConnGuard {
  pthread_mutex_t* m;
  explicit ConnGuard(pthread_mutex_t* mutex) : m(mutex) { pthread_mutex_lock(m); }
  ~ConnGuard() { pthread_mutex_unlock(m); }
};
}  // namespace

klpDbConn* klpThread::getThrdCtlConn(char kind, const char* dbName, int32_t codePage) {
  ConnGuard g(&connLock);
  for (klpDbConn* c = conns; c != nullptr; c = c->next)
    if (c->matches(kind, dbName, codePage)) return c;
  if (kind != 'O') return nullptr;
  klpDbConn* c = new (std::nothrow) klpDbConn(kind, dbName, codePage);
  if (c == nullptr) return nullptr;
  c->next = conns;
  conns = c;
  return c;
}

klpDbConn* klpThread::connect(char kind, const char* dbName, int32_t codePage) {
  klpDbConn* c = getThrdCtlConn(kind, dbName, codePage);
  ConnGuard g(&connLock);
  if (c == nullptr) {
    c = new (std::nothrow) klpDbConn(kind, dbName, codePage);
    if (c == nullptr) return nullptr;
    c->next = conns;
    conns = c;
  }
  curConn = c;
  return c;
}

int klpThread::disconnect(klpDbConn* conn) {
  ConnGuard g(&connLock);
  for (klpDbConn** p = &conns; *p != nullptr; p = &(*p)->next) {
    if (*p == conn) {
      *p = conn->next;
      if (curConn == conn) curConn = nullptr;
      conn->close();
      delete conn;
      return 0;
    }
  }
  return KLP_RC_BAD_PARM;
}

int klpThread::swapTo(klpDbConn* conn) {
  ConnGuard g(&connLock);
  for (klpDbConn* c = conns; c != nullptr; c = c->next)
    if (c == conn) {
      curConn = c;
      return 0;
    }
  return KLP_RC_BAD_PARM;
}

klpDbConn* klpThread::detachCurrentConn() {
  ConnGuard g(&connLock);
  klpDbConn* c = curConn;
  curConn = nullptr;
  return c;
}

void klpThread::cleanupConns() {
  ConnGuard g(&connLock);
  while (conns != nullptr) {
    klpDbConn* c = conns;
    conns = c->next;
    c->close();
    delete c;
  }
  curConn = nullptr;
}

int klpThread::interruptDbWork() {
  ConnGuard g(&connLock);
  if (curConn != nullptr) return curConn->interrupt();
  return dbCtx.interrupt();
}

// ---------------------------------------------------------------------------
// klpThread
// ---------------------------------------------------------------------------
klpThread::klpThread()
    : state(KLP_THREAD_EXIST),
      restart(1),
      critical(0),
      startRoutine(nullptr),
      reserved(0),
      handle(),
      hasHandle(0),
      threadId(0),
      dbCtxList("KlpDbCtxList"),
      sharedCmdList(nullptr),
      cmdList(nullptr),
      userData(nullptr),
      endCode(0),
      workBuffer(nullptr),
      conns(nullptr),
      curConn(nullptr) {
  ole.initElement("KlpThrd");
  tid.initElement("KlpThID");
  tid.object = this;
  ole.object = this;
  memset(name, 0, sizeof name);
  pthread_mutex_init(&connLock, nullptr);
  for (int i = 0; i < KLP_CMD_CODES; ++i) cmdInterest[i] = 0;
  cmdInterest[14] = cmdInterest[18] = cmdInterest[19] = 1;
  dbCtx.init();
}

klpThread::~klpThread() {
  cleanupConns();
  ordListDeChain(&dbCtx.ole);
  pthread_mutex_destroy(&connLock);
}

void klpThread::setName(const char* n) {
  memset(name, 0, sizeof name);
  if (n != nullptr) strncpy(name, n, KLP_THREAD_NAME_MAX);
}

void klpThread::check(const char* where) const {
  if (strcmp(ole.eyeCatcher, "KlpThrd") != 0)
    klpFatalStructure(where, "klpThread", this, "KlpThrd", ole.eyeCatcher);
  if (strcmp(tid.eyeCatcher, "KlpThID") != 0)
    klpFatalStructure(where, "klpThread id entry", &tid, "KlpThID", tid.eyeCatcher);
}

klpThread* klpThreadOf(OrdListElement* e) {
  if (e == nullptr) return nullptr;
  // Thread-id entries point at their thread; thread-list elements are the
  // thread's first member.
  if (strcmp(e->eyeCatcher, "KlpThID") == 0) return static_cast<klpThread*>(e->object);
  klpThread* t = reinterpret_cast<klpThread*>(e);
  t->check("klpThreadOf");
  return t;
}

klpThread* klpMainThread() { return neverDestroyed<klpThread>(); }
OrdList* klpThreadIdList() { return neverDestroyed<OrdList>(); }
OrdList* klpSharedCmdList() {
  static OrdList* list = [] {
    OrdList* l = new OrdList("KlpList");  // lives as long as the process
    l->makeShared("KlpList", 1);
    return l;
  }();
  return list;
}

klpThread* createThread(int* code, OrdList* list, klpThreadRoutine routine, const char* name,
                        const char* dbAlias, int restart, void* userData, int useSharedCmdList,
                        int critical) {
  int dummy = 0;
  if (code == nullptr) code = &dummy;
  klpThread* t = new (std::nothrow) klpThread;
  if (t == nullptr) {
    logKlpMsg(543, "createThread", KLP_DEST_SEVERITY, "1408", nullptr, 1, "klpThread");
    *code = KLP_RC_NO_MEMORY;
    return nullptr;
  }
  t->setName(name);
  if (!restart) t->restart = 0;
  t->critical = critical;
  t->startRoutine = routine;
  t->userData = userData;
  t->sharedCmdList = klpSharedCmdList();
  if (useSharedCmdList) {
    t->cmdList = t->sharedCmdList;
  } else {
    OrdList* cl = new (std::nothrow) OrdList;
    if (cl == nullptr) {
      logKlpMsg(543, "createThread", KLP_DEST_SEVERITY, "128", nullptr, 1, "OrdList");
      t->userData = nullptr;  // still the caller's
      delete t;
      *code = KLP_RC_NO_MEMORY;
      return nullptr;
    }
    cl->makeShared(t->name, 1);
    t->cmdList = cl;
  }
  if (dbAlias != nullptr) {
    size_t n = strnlen(dbAlias, KLP_DB_NAME_MAX);
    memcpy(t->dbCtx.dbAlias, dbAlias, n);
  }
  t->dbCtxList.putTail(&t->dbCtx.ole);
  *code = klpThread::start(t, list);
  return t;
}

int klpThread::start(klpThread* t, OrdList* list) {
  t->check("klpThread::start");
  if (t->hasHandle) return 0;
  traceThread(kTrcStart, "Start thread   ", t);
  pthread_attr_t attr;
  pthread_attr_init(&attr);
  pthread_attr_setstacksize(&attr, KLP_THREAD_STACK);
  t->setState(KLP_THREAD_START);
  // The new thread inherits a mask without SIGINT and SIGTERM: sent to the
  // process, they are the main thread's to handle.
  sigset_t block, old;
  erProcessSignals(&block);
  pthread_sigmask(SIG_BLOCK, &block, &old);
  pthread_t h;
  int rc = pthread_create(&h, &attr, threadTrampoline, t);
  pthread_sigmask(SIG_SETMASK, &old, nullptr);
  pthread_attr_destroy(&attr);
  if (rc != 0) {
    const char* word = createErrorName(rc);
    char num[16];
    if (word == nullptr) {
      snprintf(num, sizeof num, "%d", rc);
      logInternalError("klpThread::start", rc, "pthread_create");
      word = num;
    }
    logKlpMsg(589, "klpThread::start", KLP_DEST_SEVERITY, t->name, nullptr, 2, word,
              "CreateThread");
    t->setState(KLP_THREAD_EXIST);
    return KLP_RC_THREAD;
  }
  t->handle = h;
  t->hasHandle = 1;
  traceThread(kTrcStart, "Thread started ", t);
  if (list != nullptr) list->putTail(&t->ole);
  return 0;
}

int klpThread::prologue(klpThread* t) {
  t->check("klpThread::prologue");
  t->setState(KLP_THREAD_INIT);
  OrdList* ids = klpThreadIdList();
  // One thread takes the first prologue; any other waits until it is done,
  // since the thread-id list is made ready there.
  int expected = 0;
  bool first = g_firstPrologue.compare_exchange_strong(expected, 1);
  while (!first && g_firstPrologue.load() != 2) sched_yield();
  if (first) {
    t->setState(KLP_THREAD_EXIST);
    t->setName("Initial");
    t->hasHandle = 0;
    if (t->dbCtx.ole.oleAnchor == nullptr) t->dbCtxList.putTail(&t->dbCtx.ole);
    t->cmdList = nullptr;
    t->sharedCmdList = klpSharedCmdList();
    hsvOneTimeOnly();
    t->threadId = hsvThreadID();
    trcSetThreadName(t->name);
    if (!ids->locked) ids->makeShared("KlpThreadIDList", 0);  // never under a user
    ids->putTail(&t->tid);
    msgSetThreadNameProvider(threadNameForLogger);
    t->setState(KLP_THREAD_RUN);
  } else {
    t->threadId = hsvThreadID();
    if (t->tid.oleAnchor == nullptr) ids->putTail(&t->tid);
  }
  tlsThread = t;
  int rc = recoveryMgr::erSetRecovery(&t->rcvyMgr);
  if (rc != 0) logInternalError("klpThread::prologue", rc, "recoveryMgr::erSetRecovery");
  if (first) g_firstPrologue.store(2);
  return rc;
}

void threadEnd(klpThread* t, int code) {
  t->check("threadEnd");
  t->cleanupConns();
  free(t->userData);
  t->userData = nullptr;
  t->setEndCode(code != 0 ? code : KLP_RC_THREAD_ENDED);
  recoveryMgr::erUndoRecovery(&t->rcvyMgr);
  if (t == klpMainThread()) {
    t->setState(KLP_THREAD_STOP);
    fflush(stdout);
    exit(code != 0 ? 12 : 0);
  }
  // Off the thread-id list before the state says "ended": from then on the
  // object may be removed by a stop.
  ordListDeChain(&t->tid);
  tlsThread = nullptr;
  int32_t endCode = t->getEndCode();
  t->setState(KLP_THREAD_STOP);
  pthread_exit(reinterpret_cast<void*>(static_cast<intptr_t>(endCode)));
}

int klpThread::stop(klpThread* t) {
  t->check("klpThread::stop");
  traceThread(kTrcStop, "Stop thread    ", t);
  klpThread* caller = currentThread();
  char code[16];
  snprintf(code, sizeof code, "%d", t->getEndCode());
  logKlpMsg(590, "klpThread::stop", KLP_DEST_SEVERITY, caller ? caller->name : "Unknown",
            nullptr, 2, code, t->name);
  if (t->hasHandle && t->getState() != KLP_THREAD_STOP) {
    if (t->getState() == KLP_THREAD_RUN) {
      t->interruptDbWork();
      klpRestingSleep(KLP_STOP_WAIT_MS);
    }
    int32_t st = t->getState();
    if (st != KLP_THREAD_STOP) {
      if (st != KLP_THREAD_WAIT) {
        int rc = pthread_cancel(t->handle);
        if (rc != 0) logInternalError("klpThread::stop", KLP_RC_THREAD, "TerminateThread");
      } else {
        // A waiting thread is woken by the signal rather than cut off; it goes
        // back to its own recovery point. Our own signal, not SIGTERM: the
        // thread blocks that one, and should it have given up its recovery
        // point meanwhile, ours is ignored where SIGTERM would end the process.
        pthread_kill(t->handle, erStopSignal());
      }
    }
    traceThread(kTrcStop, "Stopped thread ", t);
  }
  if (t->getState() != KLP_THREAD_STOP) {
    setWithdrawn(&t->ole);
    return KLP_RC_RECOVERED;
  }
  int endCode = t->getEndCode();
  joinIfEnded(t);
  ordListDeChain(&t->ole);
  ordListDeChain(&t->tid);
  // Only a list of its own is emptied: the shared one holds the other
  // threads' commands.
  if (t->cmdList != nullptr && t->cmdList != t->sharedCmdList) {
    t->cmdList->delList();
    delete t->cmdList;
  }
  t->cmdList = nullptr;
  free(t->workBuffer);
  t->workBuffer = nullptr;
  if (t != klpMainThread()) delete t;
  return endCode == KLP_RC_RECOVERED ? 0 : endCode;
}

int stopAll(OrdList* list) {
  if (list == nullptr) return 0;
  int failed = 0;
  bool hold = false;
  OrdListElement* e = list->browseHead();
  while (e != nullptr) {
    OrdListElement* next = OrdList::browsePrev(e);
    klpThread* t = klpThreadOf(e);
    if (klpThread::stop(t) == KLP_RC_RECOVERED) {
      ++failed;
      if (strncmp(t->name, "HoldLThread", 11) == 0) hold = true;
    }
    e = next;
  }
  if (failed > 0) klpRestingSleep(KLP_STOP_ALL_WAIT_MS);
  if (failed == 0 || (failed == 1 && hold)) return 0;
  return KLP_RC_RECOVERED;
}

int supervise(OrdList* list, int stopping, int* highestEndCode) {
  if (list == nullptr) return 0;
  bool alive = false, working = false, finished = false;
  int highest = 0;
  OrdListElement* e = list->browseHead();
  while (e != nullptr) {
    OrdListElement* next = OrdList::browsePrev(e);
    klpThread* t = klpThreadOf(e);
    int32_t st = t->getState();
    int32_t code = t->getEndCode();
    if (st != KLP_THREAD_STOP) {
      if (st != KLP_THREAD_WAIT) alive = true;
      if (t->critical) {
        working = true;
        if (stopping && code != KLP_RC_TERMINATED && code > highest) highest = code;
      }
    } else if (!stopping && t->restart) {
      if (code == KLP_RC_TERMINATED) {
        t->setEndCode(KLP_RC_THREAD_ENDED);  // removed on the next pass
      } else if (code == KLP_RC_THREAD_ENDED) {
        klpThread::stop(t);
      } else {
        joinIfEnded(t);
        t->rcvyMgr.reset();  // the new run starts with no returns and no resources
        klpThread::start(t, nullptr);
        alive = true;
      }
    } else {
      if (code != KLP_RC_THREAD_ENDED) {
        finished = true;
        if (code != KLP_RC_TERMINATED && code > highest) highest = code;
      }
      klpThread::stop(t);
    }
    e = next;
  }
  int rc;
  if (alive) {
    if (finished && highest == KLP_RC_SHUTDOWN)
      rc = KLP_RC_SHUTDOWN;
    else if (finished)
      rc = KLP_RC_THREAD_FINISHED;
    else
      rc = working ? 0 : KLP_RC_NO_CRITICAL;
  } else {
    rc = highest == KLP_RC_SHUTDOWN ? KLP_RC_SHUTDOWN : KLP_RC_NONE_ALIVE;
  }
  if (highestEndCode != nullptr && highest > *highestEndCode) *highestEndCode = highest;
  return rc;
}

int threadStateByName(OrdList* list, const char* name) {
  if (list == nullptr || name == nullptr) return 0;
  for (OrdListElement* e = list->browseHead(); e != nullptr; e = OrdList::browsePrev(e)) {
    klpThread* t = klpThreadOf(e);
    if (strcmp(t->name, name) == 0) return t->getState();
  }
  return 0;
}

klpThread* currentThread() {
  // A thread that ran its prologue knows itself: no lock, so this is safe
  // on every log line and after a jump out of a signal handler that may
  // have interrupted the thread inside the thread-id list's lock.
  if (tlsThread != nullptr) return tlsThread;
  OrdList* ids = klpThreadIdList();
  uint64_t me = hsvThreadID();
  klpThread* found = nullptr;
  if (ids->lockList() != 0) return nullptr;
  for (OrdListElement* e = ids->olHead; e != nullptr; e = e->olePrev) {
    klpThread* t = static_cast<klpThread*>(e->object);
    if (t != nullptr && t->threadId == me) {
      found = t;
      break;
    }
  }
  ids->unlockList();
  return found;
}

int interestedInCmd(klpThread* t, int code) {
  if (code < 0 || code >= KLP_CMD_CODES) {
    char num[16];
    snprintf(num, sizeof num, "%d", code);
    logKlpMsg(8006, "klpThread::interestedInCmd", KLP_DEST_SEVERITY, num, nullptr, 0);
    return 0;
  }
  return t->cmdInterest[code];
}

void setCmdInterest(klpThread* t, int code, int value) {
  if (code < 0 || code >= KLP_CMD_CODES) {
    char num[16];
    snprintf(num, sizeof num, "%d", code);
    logKlpMsg(8006, "klpThread::setCmdInterest", KLP_DEST_SEVERITY, num, nullptr, 0);
    return;
  }
  t->cmdInterest[code] = value;
}

void klpThread::print(klpThread* t) {
  printf("klpThread::print  Thread with name %s and state %d and RC %d and RESTART %s"
         " and handle  %.*lX\n",
         t->name, t->getState(), t->getEndCode(), t->restart ? "TRUE" : "FALSE", 16,
         t->hasHandle ? static_cast<unsigned long>(t->handle) : 0UL);
  fflush(stdout);
}

void klpRestingSleep(uint32_t milliseconds) {
  klpThread* t = currentThread();
  if (t == nullptr || t->getState() == KLP_THREAD_DBWAIT) {
    hsvSleep(milliseconds);
    return;
  }
  int32_t old = t->getState();
  t->setState(KLP_THREAD_REST);
  hsvSleep(milliseconds);
  t->setState(old);
}
