// Recovery manager: one per klpThread. A process-wide signal handler jumps
// back to the current thread's recovery point; the thread then reports the
// signal, runs its recovery resources (once, last registered first) and ends
// or carries on. Also the global signal record and dump files.
//
// Setting the recovery point must happen in the frame that is jumped back to,
// so it is a macro around sigsetjmp:
//
//   klpThread* t = ...;                       // after klpThread::prologue
//   if (KLP_SET_RECOVERY_POINT(t->rcvyMgr) != 0) {
//     int rc = recoveryMgr::erRecover(&t->rcvyMgr, t);  // 2009, 2010; a fourth
//     ...end handling with rc...                        // return ends the thread
//   }
#pragma once

#include <csetjmp>
#include <csignal>
#include <cstdint>

#include "common/thread/ordlist.h"

class klpThread;

// Clean-up action of a recovery resource.
typedef void (*recoveryAction)(uint64_t argument);

struct recoveryRes {
  OrdListElement ole;  // "KlpRcvyRes:"
  int64_t registered;  // UTC seconds
  recoveryAction action;
  uint64_t argument;
};

class recoveryMgr {
 public:
  char eyeCatcher[12];
  int32_t reserved;
  int32_t recoveries;  // returns to the recovery point so far
  int32_t signal;      // signal of the last jump; 0 when none
  int32_t signalled;   // 1 after the handler jumped
  OrdList resList;     // "erResList"
  sigjmp_buf recoveryPoint;
  volatile sig_atomic_t pointSet;  // the handler jumps only once it is set

  recoveryMgr();
  ~recoveryMgr();
  recoveryMgr(const recoveryMgr&) = delete;
  recoveryMgr& operator=(const recoveryMgr&) = delete;

  // Installs the process's signal handler once. 0.
  static int erSetRecovery(recoveryMgr* mgr);
  // Installs the handler again, whatever was installed before.
  static void erReinstall();
  // Undoes recovery at thread end: a trace point only.
  static void erUndoRecovery(recoveryMgr* mgr);
  // Steps of a return to the recovery point: ends the thread with 2010 when
  // it came back more than three times, else counts the return, reports the
  // signal and answers 2009 (first return) or 2010.
  static int erRecover(recoveryMgr* mgr, klpThread* thread);
  // Reports the recorded signal (569/591) and, on the first return, runs the
  // resources last-first.
  static void erWhatSignal(recoveryMgr* mgr);
  // Runs and frees every resource, last registered first.
  void runResources();
  // Marks the recovery point as set; answers rc (see KLP_SET_RECOVERY_POINT).
  static int erArmed(recoveryMgr* mgr, int rc);
  // Fatal unless the eye-catcher is intact.
  void check(const char* where) const;
};

// The calling thread's manager; null (with internal errors, 602) when the
// caller is no registered thread.
recoveryMgr* findRcvyMgr();
// Registers a clean-up for the current thread; null on failure. The caller
// drops it with ordListDeChain(&res->ole) and delete when no longer needed.
recoveryRes* addRcvyRes(recoveryAction action, uint64_t argument);
// Unlinks and deletes a resource that is no longer needed (null accepted).
void endRcvyRes(recoveryRes* res);

// Queue actions: the argument is the address of an `HSVHIPCQueue*` that owns
// a heap object. Detach (593) or destroy (595) the queue, delete the object
// and set the pointer to null. The pointer variable must outlive the jump
// back to the recovery point: keep it in heap or static storage (or in a
// frame at or above the recovery point), never in a frame the jump discards.
void erHSVIPCQdetach(uint64_t queueRef);
void erHSVIPCQdestroy(uint64_t queueRef);

// Name of a signal: "SIGINT", "SIGILL", "SIGFPE", "SIGSEGV", "SIGTERM", else
// the number as "%d" (buf of at least 12 characters).
const char* erSignalName(int sig, char* buf, size_t bufLen);

// The process-wide global signal record (0: none). Set by the handler and
// the signal report, read and cleared by the command engine.
int erGetGlobalSignal();
void erSetGlobalSignal(int sig);
void erClearGlobalSignal();

// Writes "<dir>/<prefix>.<pid>.<tid>.DUMP" (parameter 7 and the name prefix),
// ending with the end-of-dump marker; message 8053. 0 or 803.
int erDumpStackTraceInfo(int sig, const void* siginfo, const void* ucontext);
// The same with the directory and prefix given (null/blank prefix: none).
// When path/pathLen are given, the file name is copied there.
int erDumpStackTraceTo(const char* directory, const char* prefix, int sig, const void* siginfo,
                       const void* ucontext, char* path = nullptr, size_t pathLen = 0);
extern const char erEndOfDumpMarker[17];  // "***E**O**D**M***" and its NUL

// sigsetjmp runs first (as the argument), then the point is marked as set; the
// signal mask is saved so that a jump out of the handler unblocks the signal.
#define KLP_SET_RECOVERY_POINT(mgr) \
  (::recoveryMgr::erArmed(&(mgr), sigsetjmp((mgr).recoveryPoint, 1)))
