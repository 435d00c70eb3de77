// Recovery manager: one per klpThread. A process-wide signal handler jumps
// back to the current thread's recovery point; the thread then reports the
// signal, runs its recovery resources (once, last registered first) and ends
// or carries on. Also the global signal record and dump files.
//
// Faults (SIGSEGV, SIGBUS, SIGILL) are not recovered: the handler writes one
// trap line and lets the fault end the process with its core as usual.
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

  // Installs the process's signal handler once. 0. Inside a control
  // interface call (erLibraryCall) it installs nothing: the call does.
  static int erSetRecovery(recoveryMgr* mgr);
  // Installs the handler again, whatever was installed before.
  static void erReinstall();
  // Undoes recovery at thread end: a trace point only.
  static void erUndoRecovery(recoveryMgr* mgr);
  // Steps of a return to the recovery point: ends the thread with 2010 when
  // it came back more than three times, else counts the return, reports the
  // signal and answers 2009 (first return) or 2010. Locks the thread still
  // held when the signal came are given up first. After an ending signal
  // (erCatchEndingSignals) the clean-ups run and the signal's default action
  // then ends the process.
  static int erRecover(recoveryMgr* mgr, klpThread* thread);
  // Reports the recorded signal (569/591) and, on the first return, runs the
  // resources last-first.
  static void erWhatSignal(recoveryMgr* mgr);
  // Runs and frees every resource, last registered first, down to (not
  // including) `mark`; null runs them all.
  void runResources(OrdListElement* mark = nullptr);
  // A fresh state for a thread that starts again: resources the earlier run
  // left are run, the counts and the recovery point are cleared.
  void reset();
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

// The signal a stop sends to a waiting thread: a real-time signal of our own,
// which created threads leave unblocked (they block SIGINT and SIGTERM, so
// that those reach the main thread only). The thread reports it as SIGTERM;
// one that has no recovery point any more ignores it.
int erStopSignal();
// The signals a created thread blocks: SIGINT and SIGTERM.
void erProcessSignals(sigset_t* set);

// For a program whose recovery resources must not outlive it (the command
// program's reply queue): every catchable signal whose default ends the
// process jumps to the recovery point, where the clean-ups run before the
// signal's default action ends the process. 0.
int erCatchEndingSignals();

// One call of the control interface. While it lives the process runs our
// handler for SIGINT, SIGFPE, SIGABRT and SIGTERM (the caller's are saved by
// the first call and restored when the last one returns); a signal on the
// calling thread comes back to the call's own point, and one that reaches
// another thread of the caller while a call waits is passed on to a waiting
// call (SIGINT, SIGTERM) or to the caller's own handler. A calling thread the
// library has not met is known as a thread of its own for the call.
//
//   erLibraryCall call;
//   if (KLP_SET_CALL_POINT(call) != 0) return call.recover(text, len);  // 2010
class erLibraryCall {
 public:
  sigjmp_buf point;
  volatile sig_atomic_t armed;
  volatile sig_atomic_t signal;  // as reported; 0 when none

  erLibraryCall();
  ~erLibraryCall();
  erLibraryCall(const erLibraryCall&) = delete;
  erLibraryCall& operator=(const erLibraryCall&) = delete;

  // After a signal brought the call back: gives up the locks the call held,
  // runs the clean-ups it registered (last first), puts the text of message
  // 591 into text and answers 2010.
  int recover(char* text, size_t textLen);
  static int armedAt(erLibraryCall* call, int rc);

 private:
  erLibraryCall* outer_;
  klpThread* own_;         // the thread object made for this call, if any
  OrdListElement* mark_;   // last resource registered before the call
};

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
#define KLP_SET_CALL_POINT(call) (::erLibraryCall::armedAt(&(call), sigsetjmp((call).point, 1)))
