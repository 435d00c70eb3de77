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

// The signals the process handles: SIGINT, SIGFPE and SIGABRT; the hardware
// faults, which the signal report knows (SIGSEGV, SIGILL) and which come with
// a dump; and SIGTERM, which a thread stop aims at a waiting thread and which
// the signal report turns into the global signal record.
const int kSignals[] = {SIGINT, SIGFPE, SIGABRT, SIGSEGV, SIGBUS, SIGILL, SIGTERM};

void signalTrap(int sig, siginfo_t* info, void* context);

int installOne(int sig) {
  struct sigaction sa;
  memset(&sa, 0, sizeof sa);
  sa.sa_sigaction = signalTrap;
  sa.sa_flags = SA_SIGINFO;
  sigemptyset(&sa.sa_mask);
  return sigaction(sig, &sa, nullptr);
}

void reinstall(int sig, const char* name) {
  if (installOne(sig) != 0) {
    printf("Signal() gets error return errno %dduring reinstall of signal %s.\n", errno, name);
    fflush(stdout);
  }
}

void signalTrap(int sig, siginfo_t* info, void* context) {
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
    case SIGSEGV:
    case SIGBUS:
    case SIGILL:
      // The fault's own diagnostics, while its context is still at hand.
      erDumpStackTraceInfo(sig, info, context);
      break;
    default:
      printf("signalTrap() received an unexpected signal number %d\n", sig);
      fflush(stdout);
      break;
  }
  if (sig == SIGINT || sig == SIGABRT) erSetGlobalSignal(sig);

  // The thread-local pointer rather than a search under the thread-id list's
  // lock: the signal may have interrupted this thread inside that lock.
  klpThread* t = klpTlsCurrentThread();
  if (t != nullptr && t->rcvyMgr.pointSet) {
    recoveryMgr* mgr = &t->rcvyMgr;
    mgr->signalled = 1;
    mgr->signal = sig;
    siglongjmp(mgr->recoveryPoint, 1);
  }
  // No recovery point to go back to. The thread's clean-ups still run (a
  // control-interface call keeps its reply queue there).
  if (t != nullptr) t->rcvyMgr.runResources();
  // Faults and SIGTERM were added to the set for threads that can recover;
  // elsewhere they take their default course instead of leaving the process
  // running damaged or ignoring a termination request.
  if (sig == SIGSEGV || sig == SIGBUS || sig == SIGILL || sig == SIGTERM) {
    signal(sig, SIG_DFL);
    raise(sig);
    return;
  }
  logInternalError("findRcvyMgr", KLP_RC_NO_MANAGER, "findThread");
  logInternalError("signalHandler", KLP_RC_NO_MANAGER, "findRcvyMgr");
  char num[16];
  snprintf(num, sizeof num, "%d", sig);
  logKlpMsg(591, "signalHandler", KLP_DEST_SEVERITY, "Unknown", nullptr, 2, "Non-handled", num);
  // A registered thread that has no recovery point yet still ends through
  // its own end routine, so that its state and end code say so.
  if (t != nullptr) threadEnd(t, KLP_RC_RECOVERED);
  pthread_exit(reinterpret_cast<void*>(static_cast<intptr_t>(KLP_RC_RECOVERED)));
}

}  // namespace

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
  if (g_handlerInstalled.compare_exchange_strong(expected, 1)) {
    for (int sig : kSignals) installOne(sig);
  }
  trcExit(kTrcComp, 1, TRC_RET_RC, 0, 0);
  return 0;
}

void recoveryMgr::erReinstall() {
  for (int sig : kSignals) installOne(sig);
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
  if (mgr->recoveries > 2) threadEnd(thread, KLP_RC_RECOVERY_LIMIT);
  ++mgr->recoveries;
  int rc = mgr->recoveries == 1 ? KLP_RC_RECOVERED : KLP_RC_RECOVERY_LIMIT;
  erWhatSignal(mgr);
  return rc;
}

void recoveryMgr::erWhatSignal(recoveryMgr* mgr) {
  mgr->check("recoveryMgr::erWhatSignal");
  if (mgr->signal != 0) {
    const char* status = "Handled";
    char buf[16];
    const char* name = erSignalName(mgr->signal, buf, sizeof buf);
    switch (mgr->signal) {
      case SIGINT:
      case SIGTERM:
        erSetGlobalSignal(mgr->signal);
        break;
      case SIGILL:
      case SIGFPE:
        break;
      case SIGSEGV:
        logKlpMsg(569, "recoveryMgr::erWhatSignal", KLP_DEST_SEVERITY, name, nullptr, 0);
        break;
      default:
        status = "Non-handled";
        break;
    }
    klpThread* t = currentThread();
    logKlpMsg(591, "recoveryMgr::erWhatSignal", KLP_DEST_SEVERITY, t ? t->name : "Unknown",
              nullptr, 2, status, name);
  }
  if (mgr->recoveries == 1) mgr->runResources();
}

void recoveryMgr::runResources() {
  while (OrdListElement* e = resList.getTail()) {
    recoveryRes* res = reinterpret_cast<recoveryRes*>(e);
    if (memcmp(res->ole.eyeCatcher, "KlpRcvyRes:", 11) != 0)
      klpFatalStructure("recoveryMgr::runResources", "recoveryRes", res, "KlpRcvyRes:",
                        res->ole.eyeCatcher);
    if (res->action != nullptr) res->action(res->argument);
    delete res;
  }
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
