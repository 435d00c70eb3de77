#include "common/thread/recoverymgr.h"

#include <fenv.h>
#include <pthread.h>

#include <atomic>
#include <cerrno>
#include <cinttypes>
#include <cstdio>
#include <cstring>
#include <new>

#include "common/msg/klplog.h"
#include "common/parms/klpparm.h"
#include "common/platform/hsv.h"
#include "common/thread/klpthread.h"
#include "common/thread/threadlocal.h"
#include "common/trace/trace.h"
#include "common/util/klprc.h"
#if __has_include("common/env/klpenv.h")
#include "common/env/klpenv.h"
#define KLP_HAVE_ENV 1
#endif

namespace {

constexpr int kTrcComp = 7;  // trace component of the recovery manager

std::atomic<int> g_globalSignal{0};
std::atomic<int> g_handlerInstalled{0};

// What a program installs: SIGINT, SIGFPE and SIGABRT; SIGTERM, which the
// signal report turns into the global signal record; the stop signal; and
// the faults, which only get a trap line before they end the process.
const int kSignals[] = {SIGINT, SIGFPE, SIGABRT, SIGTERM, SIGSEGV, SIGBUS, SIGILL};
// What a control interface call installs for its duration.
const int kCallSignals[] = {SIGINT, SIGFPE, SIGABRT, SIGTERM};
constexpr size_t kCallCount = sizeof kCallSignals / sizeof kCallSignals[0];
// Catchable signals whose default ends the process, beyond those above.
const int kEndingSignals[] = {SIGHUP,  SIGQUIT,   SIGPIPE, SIGALRM, SIGUSR1, SIGUSR2,  SIGVTALRM,
                              SIGPROF, SIGXCPU,   SIGXFSZ, SIGIO,   SIGPWR,  SIGSTKFLT, SIGSYS};

// Signals taken over by erCatchEndingSignals (real-time ones by number).
std::atomic<uint64_t> g_ending{0};

thread_local erLibraryCall* tlsCall = nullptr;

// The calls in progress, and what the caller had installed before the first.
pthread_mutex_t g_callLock = PTHREAD_MUTEX_INITIALIZER;
std::atomic<int> g_calls{0};
struct sigaction g_callerActions[kCallCount];
std::atomic<pthread_t> g_callThread{};
std::atomic<int> g_callWaiting{0};  // g_callThread is a thread in a call

bool isEnding(int sig) {
  return sig > 0 && sig < 64 && (g_ending.load(std::memory_order_relaxed) >> sig & 1) != 0;
}

bool isFault(int sig) { return sig == SIGSEGV || sig == SIGBUS || sig == SIGILL; }

void signalTrap(int sig, siginfo_t* info, void* context);

int installOne(int sig) {
  struct sigaction sa;
  memset(&sa, 0, sizeof sa);
  sa.sa_sigaction = signalTrap;
  sa.sa_flags = SA_SIGINFO;
  sigemptyset(&sa.sa_mask);
  return sigaction(sig, &sa, nullptr);
}

void installDefault(int sig) {
  struct sigaction sa;
  memset(&sa, 0, sizeof sa);
  sa.sa_handler = SIG_DFL;
  sigemptyset(&sa.sa_mask);
  sigaction(sig, &sa, nullptr);
}

// Lets the signal's default action end the process: it is delivered as soon
// as the handler returns (or, outside one, at once).
void endBySignal(int sig) {
  installDefault(sig);
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, sig);
  raise(sig);
  pthread_sigmask(SIG_UNBLOCK, &set, nullptr);
}

void reinstall(int sig, const char* name) {
  if (installOne(sig) != 0) {
    printf("Signal() gets error return errno %dduring reinstall of signal %s.\n", errno, name);
    fflush(stdout);
  }
}

// A signal that reached a thread of the caller which is in no call: a
// termination request goes to a call that waits; anything else to the
// handler the caller had installed.
void passOn(int sig, siginfo_t* info, void* context) {
  if ((sig == SIGINT || sig == SIGTERM) && g_callWaiting.load()) {
    pthread_kill(g_callThread.load(), sig);
    return;
  }
  for (size_t i = 0; i < kCallCount; ++i) {
    if (kCallSignals[i] != sig) continue;
    const struct sigaction& a = g_callerActions[i];
    if (a.sa_flags & SA_SIGINFO) {
      a.sa_sigaction(sig, info, context);
    } else if (a.sa_handler == SIG_DFL) {
      endBySignal(sig);
    } else if (a.sa_handler != SIG_IGN) {
      a.sa_handler(sig);
    }
    return;
  }
}

// The end of the handler when there is no recovery point to go back to: the
// thread is reported and ended.
[[noreturn]] void endUnrecoverable(int sig, klpThread* t) {
  char buf[16];
  if (t == nullptr) {
    logInternalError("findRcvyMgr", KLP_RC_NO_MANAGER, "findThread");
    logInternalError("signalHandler", KLP_RC_NO_MANAGER, "findRcvyMgr");
    snprintf(buf, sizeof buf, "%d", sig);
    logKlpMsg(591, "signalHandler", KLP_DEST_SEVERITY, "Unknown", nullptr, 2, "Non-handled", buf);
  } else {
    // Found, but it never set its recovery point (or has given it up).
    logInternalError("signalHandler", KLP_RC_RECOVERED, "setRecoveryPoint",
                     "the thread has no recovery point");
    logKlpMsg(591, "signalHandler", KLP_DEST_SEVERITY, t->name, nullptr, 2, "Non-handled",
              erSignalName(sig, buf, sizeof buf));
    // Its clean-ups still run: nothing else would.
    t->rcvyMgr.runResources();
  }
  klpReleaseHeldLocks();
  // A registered thread ends through its own end routine, so that its
  // state and end code say so.
  if (t != nullptr) threadEnd(t, KLP_RC_RECOVERED);
  pthread_exit(reinterpret_cast<void*>(static_cast<intptr_t>(KLP_RC_RECOVERED)));
}

void signalTrap(int sig, siginfo_t* info, void* context) {
  klpThread* t = klpTlsCurrentThread();
  if (isFault(sig)) {
    // Diagnostics written from here could deadlock (the fault may lie
    // inside malloc or the logger): one trap line, then the fault's own
    // course, core included.
    hsvTrapLine(sig, t != nullptr ? t->name : nullptr);
    endBySignal(sig);
    return;
  }
  bool stop = sig == erStopSignal();
  bool ending = isEnding(sig);
  switch (sig) {
    case SIGABRT:
      reinstall(SIGABRT, "SIGABRT");
      break;
    case SIGFPE:
      reinstall(SIGFPE, "SIGFPE");
      fesetenv(FE_DFL_ENV);
      break;
    case SIGINT:
    case SIGTERM:
      break;
    default:
      if (!stop && !ending) {
        printf("signalTrap() received an unexpected signal number %d\n", sig);
        fflush(stdout);
      }
      break;
  }
  if (sig == SIGINT || sig == SIGABRT) erSetGlobalSignal(sig);
  int reported = stop ? SIGTERM : sig;

  erLibraryCall* call = tlsCall;
  if (call != nullptr && call->armed) {
    call->signal = reported;
    siglongjmp(call->point, 1);
  }
  // The thread-local pointer rather than a search under the thread-id list's
  // lock: the signal may have interrupted this thread inside that lock.
  if (t != nullptr && t->rcvyMgr.pointSet) {
    // A second ending signal (a write to a closed pipe while the first is
    // reported) must not come back here.
    if (ending) signal(sig, SIG_IGN);
    recoveryMgr* mgr = &t->rcvyMgr;
    mgr->signalled = 1;
    mgr->signal = reported;
    siglongjmp(mgr->recoveryPoint, 1);
  }
  // A stop that came after the thread gave up its recovery point: it is
  // ending anyway, and a stop never ends the process.
  if (stop) return;
  if (ending) {
    endBySignal(sig);
    return;
  }
  // Our handler is in place for a control interface call on another thread:
  // this thread is the caller's, not ours.
  if (g_calls.load() > 0) {
    passOn(sig, info, context);
    return;
  }
  // A termination request nobody can turn into an orderly stop.
  if (sig == SIGTERM) {
    endBySignal(sig);
    return;
  }
  endUnrecoverable(sig, t);
}

// "Handled" for the signals the report knows, else "Non-handled".
const char* signalStatus(int sig) {
  switch (sig) {
    case SIGINT:
    case SIGTERM:
    case SIGILL:
    case SIGFPE:
    case SIGSEGV:
      return "Handled";
    default:
      return "Non-handled";
  }
}

}  // namespace

int erStopSignal() { return SIGRTMIN + 2; }

void erProcessSignals(sigset_t* set) {
  sigemptyset(set);
  sigaddset(set, SIGINT);
  sigaddset(set, SIGTERM);
}

int erCatchEndingSignals() {
  uint64_t mask = 0;
  for (int sig : kEndingSignals) mask |= uint64_t{1} << sig;
  for (int sig = SIGRTMIN; sig <= SIGRTMAX && sig < 64; ++sig)
    if (sig != erStopSignal()) mask |= uint64_t{1} << sig;
  g_ending.store(mask);
  for (int sig = 1; sig < 64; ++sig)
    if (mask >> sig & 1) installOne(sig);
  return 0;
}

const char erEndOfDumpMarker[17] = "***E**O**D**M***";

const char* erSignalName(int sig, char* buf, size_t bufLen) {
  switch (sig) {
    case SIGINT: return "SIGINT";
    case SIGILL: return "SIGILL";
    case SIGFPE: return "SIGFPE";
    case SIGSEGV: return "SIGSEGV";
    case SIGTERM: return "SIGTERM";
    default:
      snprintf(buf, bufLen, "%d", sig);
      return buf;
  }
}

int erGetGlobalSignal() { return g_globalSignal.load(); }
void erSetGlobalSignal(int sig) { g_globalSignal.store(sig); }
void erClearGlobalSignal() { g_globalSignal.store(0); }

// ---------------------------------------------------------------------------
// recoveryMgr
// ---------------------------------------------------------------------------
recoveryMgr::recoveryMgr()
    : reserved(0), recoveries(0), signal(0), signalled(0), resList("erResList"), pointSet(0) {
  memset(eyeCatcher, 0, sizeof eyeCatcher);
  memcpy(eyeCatcher, "KlpRcvyMgr:", 11);
  memset(&recoveryPoint, 0, sizeof recoveryPoint);
}

recoveryMgr::~recoveryMgr() { pointSet = 0; }

void recoveryMgr::check(const char* where) const {
  if (memcmp(eyeCatcher, "KlpRcvyMgr:", 11) != 0)
    klpFatalStructure(where, "recoveryMgr", this, "KlpRcvyMgr:", eyeCatcher);
}

int recoveryMgr::erSetRecovery(recoveryMgr* mgr) {
  trcEntry(kTrcComp, 1);
  if (mgr != nullptr) mgr->check("recoveryMgr::erSetRecovery");
  int expected = 0;
  // Inside a control interface call the process is the caller's: the call
  // brings its own handling and gives the caller's back.
  if (tlsCall == nullptr && g_handlerInstalled.compare_exchange_strong(expected, 1)) erReinstall();
  trcExitRc(kTrcComp, 1, 0);
  return 0;
}

void recoveryMgr::erReinstall() {
  for (int sig : kSignals) installOne(sig);
  installOne(erStopSignal());
  g_handlerInstalled.store(1);
}

void recoveryMgr::erUndoRecovery(recoveryMgr* mgr) {
  trcEntry(kTrcComp, 2);
  if (mgr != nullptr) mgr->pointSet = 0;  // its frame is about to go
  trcExit(kTrcComp, 2, TRC_RET_NONE);
}

int recoveryMgr::erArmed(recoveryMgr* mgr, int rc) {
  mgr->pointSet = 1;
  return rc;
}

int recoveryMgr::erRecover(recoveryMgr* mgr, klpThread* thread) {
  mgr->check("recoveryMgr::erRecover");
  // Whatever list or queue operation the signal cut short is abandoned; its
  // locks must not stay held by a thread that carries on or ends.
  klpReleaseHeldLocks();
  bool ending = isEnding(mgr->signal);
  if (mgr->recoveries > 2 && !ending) threadEnd(thread, KLP_RC_RECOVERY_LIMIT);
  ++mgr->recoveries;
  int rc = mgr->recoveries == 1 ? KLP_RC_RECOVERED : KLP_RC_RECOVERY_LIMIT;
  erWhatSignal(mgr);
  if (ending) {
    fflush(stdout);
    endBySignal(mgr->signal);
  }
  return rc;
}

void recoveryMgr::erWhatSignal(recoveryMgr* mgr) {
  mgr->check("recoveryMgr::erWhatSignal");
  if (mgr->signal != 0) {
    char buf[16];
    const char* name = erSignalName(mgr->signal, buf, sizeof buf);
    if (mgr->signal == SIGINT || mgr->signal == SIGTERM) erSetGlobalSignal(mgr->signal);
    if (mgr->signal == SIGSEGV)
      logKlpMsg(569, "recoveryMgr::erWhatSignal", KLP_DEST_SEVERITY, name, nullptr, 0);
    klpThread* t = currentThread();
    logKlpMsg(591, "recoveryMgr::erWhatSignal", KLP_DEST_SEVERITY, t ? t->name : "Unknown",
              nullptr, 2, signalStatus(mgr->signal), name);
  }
  if (mgr->recoveries == 1) mgr->runResources();
}

void recoveryMgr::runResources(OrdListElement* mark) {
  for (;;) {
    OrdListElement* e = resList.olTail;
    if (e == nullptr || e == mark) break;
    e = resList.getTail();
    if (e == nullptr) break;
    recoveryRes* res = reinterpret_cast<recoveryRes*>(e);
    if (memcmp(res->ole.eyeCatcher, "KlpRcvyRes:", 11) != 0)
      klpFatalStructure("recoveryMgr::runResources", "recoveryRes", res, "KlpRcvyRes:",
                        res->ole.eyeCatcher);
    if (res->action != nullptr) res->action(res->argument);
    delete res;
  }
}

void recoveryMgr::reset() {
  check("recoveryMgr::reset");
  runResources();
  pointSet = 0;
  recoveries = 0;
  signal = 0;
  signalled = 0;
}

// ---------------------------------------------------------------------------
// Control interface calls
// ---------------------------------------------------------------------------
erLibraryCall::erLibraryCall() : armed(0), signal(0), outer_(tlsCall), own_(nullptr), mark_(nullptr) {
  pthread_mutex_lock(&g_callLock);
  if (g_calls.load() == 0) {
    for (size_t i = 0; i < kCallCount; ++i) sigaction(kCallSignals[i], nullptr, &g_callerActions[i]);
    for (int sig : kCallSignals) installOne(sig);
  }
  g_calls.fetch_add(1);
  g_callThread.store(pthread_self());
  g_callWaiting.store(1);
  pthread_mutex_unlock(&g_callLock);
  tlsCall = this;
  klpThread* t = currentThread();
  if (t == nullptr && klpMainThread()->getState() != KLP_THREAD_EXIST) {
    // The main thread object belongs to another thread of the caller: this
    // one gets its own for the call, so that the call's clean-ups are kept.
    own_ = new (std::nothrow) klpThread;
    if (own_ != nullptr) {
      own_->setName("ApiCaller");
      klpThread::prologue(own_);
      t = own_;
    }
  }
  if (t != nullptr) mark_ = t->rcvyMgr.resList.olTail;
}

erLibraryCall::~erLibraryCall() {
  armed = 0;
  if (own_ != nullptr) {
    own_->rcvyMgr.runResources();
    ordListDeChain(&own_->tid);
    klpTlsSetCurrentThread(nullptr);
    delete own_;
  }
  tlsCall = outer_;
  pthread_mutex_lock(&g_callLock);
  if (pthread_equal(g_callThread.load(), pthread_self())) g_callWaiting.store(0);
  if (g_calls.fetch_sub(1) == 1) {
    for (size_t i = 0; i < kCallCount; ++i) sigaction(kCallSignals[i], &g_callerActions[i], nullptr);
  }
  pthread_mutex_unlock(&g_callLock);
}

int erLibraryCall::armedAt(erLibraryCall* call, int rc) {
  call->armed = 1;
  return rc;
}

int erLibraryCall::recover(char* text, size_t textLen) {
  armed = 0;
  klpReleaseHeldLocks();
  klpThread* t = currentThread();
  if (t != nullptr) t->rcvyMgr.runResources(mark_);
  if (text != nullptr && textLen > 2) {
    // The caller's result text, composed without a logger of the caller's.
    char buf[2 + 1024 + 1];
    memset(buf, 0, sizeof buf);
    klpMsgCtx ctx{};
    ctx.wantText = 1;
    ctx.bufferChars = 1024;
    ctx.buffer = buf;
    char name[16];
    int sig = signal;
    memset(text, 0, textLen);
    if (logKlpMsg(591, "signalHandler", KLP_DEST_SEVERITY, t ? t->name : "Unknown", &ctx, 2,
                  signalStatus(sig), erSignalName(sig, name, sizeof name)) == 0) {
      uint16_t len;
      memcpy(&len, buf, sizeof len);
      size_t n = strnlen(buf + 2, len < 1024 ? len : 1024);
      if (n > textLen - 1) n = textLen - 1;
      memcpy(text, buf + 2, n);
    }
  }
  return KLP_RC_RECOVERY_LIMIT;
}

// ---------------------------------------------------------------------------
// Resources
// ---------------------------------------------------------------------------
recoveryMgr* findRcvyMgr() {
  klpThread* t = currentThread();
  if (t == nullptr) {
    logInternalError("findRcvyMgr", KLP_RC_NO_MANAGER, "findThread");
    return nullptr;
  }
  return &t->rcvyMgr;
}

recoveryRes* addRcvyRes(recoveryAction action, uint64_t argument) {
  recoveryMgr* mgr = findRcvyMgr();
  if (mgr == nullptr) {
    logInternalError("addRcvyRes", KLP_RC_NO_MANAGER, "findRcvyMgr");
    return nullptr;
  }
  recoveryRes* res = new (std::nothrow) recoveryRes;
  if (res == nullptr) {
    logKlpMsg(543, "addRcvyRes", KLP_DEST_SEVERITY, "88", nullptr, 1, "recoveryRes");
    return nullptr;
  }
  res->ole.initElement("KlpRcvyRes:");
  res->registered = hsvTimeGetUTC().seconds;
  res->action = action;
  res->argument = argument;
  mgr->resList.putTail(&res->ole);
  return res;
}

void endRcvyRes(recoveryRes* res) {
  if (res == nullptr) return;
  ordListDeChain(&res->ole);
  delete res;
}

namespace {
void queueAction(uint64_t queueRef, bool destroy) {
  HSVHIPCQueue** ref = reinterpret_cast<HSVHIPCQueue**>(static_cast<uintptr_t>(queueRef));
  if (ref != nullptr && *ref != nullptr) {
    if (destroy)
      (*ref)->destroy();
    else
      (*ref)->detach();
    delete *ref;
    *ref = nullptr;
  }
  char text[24];
  snprintf(text, sizeof text, "%016" PRIx64, queueRef);
  logKlpMsg(destroy ? 595 : 593, "erHSVIPCQdestroy", KLP_DEST_SEVERITY, text, nullptr, 0);
}
}  // namespace

void erHSVIPCQdetach(uint64_t queueRef) { queueAction(queueRef, false); }
void erHSVIPCQdestroy(uint64_t queueRef) { queueAction(queueRef, true); }

// ---------------------------------------------------------------------------
// Dump files
// ---------------------------------------------------------------------------
int erDumpStackTraceTo(const char* directory, const char* prefix, int sig, const void* siginfo,
                       const void* ucontext, char* pathOut, size_t pathLen) {
  // An empty directory would put the file at the root of the file system.
  const char* dir = (directory != nullptr && directory[0] != '\0') ? directory : ".";
  const char* pre = prefix != nullptr ? prefix : "";
  bool blank = true;
  for (const char* p = pre; *p; ++p)
    if (*p != ' ') blank = false;
  if (blank) pre = "";
  char path[1100];
  int n = snprintf(path, sizeof path, "%s%s%s.%d.%lu.DUMP", dir, "/", pre, hsvProcessID(),
                   static_cast<unsigned long>(hsvThreadID()));
  if (pathOut != nullptr && pathLen > 0) snprintf(pathOut, pathLen, "%s", path);
  if (n < 0 || static_cast<size_t>(n) >= sizeof path) {
    logInternalError("erDumpStackTraceInfo", KLP_RC_DUMP_FILE, "HSVTrapFile::isValid",
                     "dump file name too long");
    return KLP_RC_DUMP_FILE;
  }
  HSVTrapFile file;
  file.open(path, HSV_TRAPFILE_OPEN_OPTION);
  if (!file.isValid()) {
    logInternalError("erDumpStackTraceInfo", KLP_RC_DUMP_FILE, "HSVTrapFile::isValid", path);
    return KLP_RC_DUMP_FILE;
  }
  file.seekToEnd();
  file.dump(HSV_TRAPFILE_DUMP_OPTION, sig, siginfo, ucontext);
  file.write(erEndOfDumpMarker, sizeof erEndOfDumpMarker);
  file.close();
  char buf[16];
  logKlpMsg(8053, "erDumpStackTraceInfo", KLP_DEST_SEVERITY, erSignalName(sig, buf, sizeof buf),
            nullptr, 1, path);
  return 0;
}

int erDumpStackTraceInfo(int sig, const void* siginfo, const void* ucontext) {
  const char* dir = nullptr;
  if (klpParmClass* parms = klpGetCurrentParms()) dir = parms->getParmString(7);
  const char* prefix = nullptr;
#ifdef KLP_HAVE_ENV
  prefix = getEnvNamePrefix(klpGetEnv());
#endif
  return erDumpStackTraceTo(dir, prefix, sig, siginfo, ucontext);
}
