#include "common/thread/recoverymgr.h"

#include <gtest/gtest.h>
#include <sys/resource.h>
#include <unistd.h>

#include <cinttypes>
#include <cstdio>
#include <filesystem>
#include <string>

#include "common/platform/hsv.h"
#include "common/thread/klpthread.h"
#include "common/thread/thread_testutil.h"
#include "common/util/klprc.h"

// The recovery handler issues its messages from within the signal handler,
// as the design asks; the signals of these tests are raised synchronously by
// the receiving thread itself.
extern "C" const char* __tsan_default_options() { return "report_signal_unsafe=0"; }

namespace {

// Signal tests run in forked children: the handler jumps, threads end and
// the process-wide record changes, none of which may touch the test process.

void say(const char* text) {
  fputs(text, stdout);
  fflush(stdout);
}

void action(uint64_t arg) { printf("action %d\n", static_cast<int>(arg)), fflush(stdout); }

// Created threads block SIGINT and SIGTERM; these tests raise them on the
// thread itself on purpose.
void raiseHere(int sig) {
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, sig);
  pthread_sigmask(SIG_UNBLOCK, &set, nullptr);
  raise(sig);
}

// Raises SIGINT again after every return to its recovery point; the fourth
// return ends it. Resources 1, 2 before the first signal, 3 after it.
volatile int g_stage = 0;
void signalledBody(klpThread* t) {
  klpThread::prologue(t);
  if (KLP_SET_RECOVERY_POINT(t->rcvyMgr) != 0) {
    int rc = recoveryMgr::erRecover(&t->rcvyMgr, t);
    printf("return %d rc=%d signal=%d\n", t->rcvyMgr.recoveries, rc, t->rcvyMgr.signal);
    fflush(stdout);
  }
  if (g_stage == 0) {
    addRcvyRes(action, 1);
    addRcvyRes(action, 2);
  } else if (g_stage == 1) {
    addRcvyRes(action, 3);
  }
  g_stage = g_stage + 1;
  raiseHere(SIGINT);
  say("not reached\n");
}

// Takes the signal g_raise while it holds the thread-id list's lock, which
// the jump abandons: neither the report nor the thread's end may hang on it.
volatile int g_raise = SIGINT;
void insideLockBody(klpThread* t) {
  klpThread::prologue(t);
  if (KLP_SET_RECOVERY_POINT(t->rcvyMgr) != 0) threadEnd(t, recoveryMgr::erRecover(&t->rcvyMgr, t));
  klpThreadIdList()->lockList();
  raiseHere(g_raise);
  threadEnd(t, 0);
}

void pointlessBody(klpThread* t) {
  klpThread::prologue(t);
  addRcvyRes(action, 7);  // still runs: nothing else would clean up
  raiseHere(SIGINT);      // before any recovery point
  say("not reached\n");
}

HSVHIPCQueue* g_queue = nullptr;
bool g_destroyQueue = true;
void queueBody(klpThread* t) {
  klpThread::prologue(t);
  // Registered on the thread that will be signalled, as its own resource.
  addRcvyRes(g_destroyQueue ? erHSVIPCQdestroy : erHSVIPCQdetach,
             reinterpret_cast<uint64_t>(&g_queue));
  if (KLP_SET_RECOVERY_POINT(t->rcvyMgr) != 0) {
    int rc = recoveryMgr::erRecover(&t->rcvyMgr, t);
    printf("queue pointer %s\n", g_queue ? "kept" : "cleared");
    threadEnd(t, rc);
  }
  raiseHere(SIGINT);
  threadEnd(t, 0);
}

// First run: a signal, so it ends with 2009 and supervision starts it
// again. Second run: a resource, then a signal at which the resource must
// run as on any first return.
std::atomic<int> g_run{0};
void restartedBody(klpThread* t) {
  klpThread::prologue(t);
  int run = ++g_run;
  if (KLP_SET_RECOVERY_POINT(t->rcvyMgr) != 0) {
    int rc = recoveryMgr::erRecover(&t->rcvyMgr, t);
    printf("run %d rc=%d\n", run, rc);
    fflush(stdout);
    threadEnd(t, run == 1 ? rc : 0);
  }
  if (run == 2) addRcvyRes(action, 5);
  raiseHere(SIGINT);
}

// Starts a thread with the given body in the child, waits for it and prints
// how it ended.
int runThread(klpThreadRoutine body, const char* name) {
  recoveryMgr::erReinstall();
  erClearGlobalSignal();
  OrdList list("Threads");
  list.makeShared(nullptr, 1);
  int code = -1;
  klpThread* t = createThread(&code, &list, body, name, nullptr, 1, nullptr, 0, 0);
  if (code != 0) return 90;
  void* ret = nullptr;
  pthread_join(t->handle, &ret);
  printf("end=%ld code=%d global=%d\n", static_cast<long>(reinterpret_cast<intptr_t>(ret)),
         t->getEndCode(), erGetGlobalSignal());
  return 0;
}

// A child with the main thread registered and a capturing logger; answers
// the child's standard output without the logger's lines.
struct SigRecovery : ::testing::Test {
  klpThread* mainThr = thrtest::mainReady();
  thrtest::LogCapture cap;
  std::string child(const std::function<int()>& body) {
    auto c = thrtest::inChild(cap.dir(), body);
    EXPECT_TRUE(c.exited) << c.out;
    EXPECT_EQ(0, c.exitCode);
    return thrtest::withoutMessages(c.out);
  }
};

TEST_F(SigRecovery, ResourcesRunLastFirstOnceAndTheFourthReturnEndsTheThread) {
  EXPECT_EQ("action 2\n"
            "action 1\n"
            "return 1 rc=2009 signal=2\n"
            "return 2 rc=2010 signal=2\n"  // no resource ran: 3 stays registered
            "return 3 rc=2010 signal=2\n"
            "end=2010 code=2010 global=2\n",
            child([] { return runThread(signalledBody, "Signalled"); }));
  // Reported at each of the three returns; the fourth ends the thread first.
  EXPECT_EQ(3u, cap.issued(591).size());
  EXPECT_TRUE(cap.issuedWith(591, {"Signalled", "Handled", "SIGINT"})) << cap.log();
}

TEST_F(SigRecovery, ASignalOnAnUnregisteredThreadEndsItWith2009AndLeavesNoLockHeld) {
  // The thread is inside the thread-id list's lock, as it is while it looks
  // itself up: the handler's messages look it up again.
  EXPECT_EQ("end=2009 list free\n", child([] {
              recoveryMgr::erReinstall();
              pthread_t raw;
              pthread_create(
                  &raw, nullptr,
                  [](void*) -> void* {
                    klpThreadIdList()->lockList();
                    raise(SIGINT);
                    say("not reached\n");
                    return nullptr;
                  },
                  nullptr);
              void* ret = nullptr;
              pthread_join(raw, &ret);
              klpThreadIdList()->lockList();
              klpThreadIdList()->unlockList();
              printf("end=%ld list free\n", static_cast<long>(reinterpret_cast<intptr_t>(ret)));
              return 0;
            }));
  EXPECT_TRUE(cap.issuedWith(591, {"Unknown", "Non-handled", "2"})) << cap.log();
  EXPECT_TRUE(cap.issuedWith(589, {"findRcvyMgr", "602", "findThread"})) << cap.log();
  EXPECT_TRUE(cap.issuedWith(589, {"signalHandler", "602", "findRcvyMgr"})) << cap.log();
}

TEST_F(SigRecovery, ARegisteredThreadWithoutRecoveryPointIsNamedAndEndsThroughThreadEnd) {
  // The end code is stored (and the state is 6) as for any other end.
  EXPECT_EQ("action 7\nend=2009 code=2009 global=2\n",
            child([] { return runThread(pointlessBody, "NoPoint"); }));
  EXPECT_TRUE(cap.issuedWith(591, {"NoPoint", "Non-handled", "SIGINT"})) << cap.log();
  EXPECT_TRUE(cap.issuedWith(589, {"signalHandler", "2009", "setRecoveryPoint"})) << cap.log();
  EXPECT_TRUE(cap.issued(591).size() == 1 && !cap.issuedWith(591, {"Unknown"})) << cap.log();
}

TEST_F(SigRecovery, ASignalInsideTheThreadIdListLockNeitherHangsTheEndNorKeepsTheLock) {
  // The stop's own signal is reported as SIGTERM.
  for (int sig : {SIGINT, erStopSignal()}) {
    g_raise = sig;
    std::string global = sig == SIGINT ? "2" : "15";
    EXPECT_EQ("end=2009 code=2009 global=" + global + "\nlist free\n", child([] {
                int rc = runThread(insideLockBody, "InLock");
                // The thread is gone: the list must be free for the others.
                klpThreadIdList()->lockList();
                klpThreadIdList()->unlockList();
                say("list free\n");
                return rc;
              }));
  }
  EXPECT_TRUE(cap.issuedWith(591, {"InLock", "Handled", "SIGINT"})) << cap.log();
  EXPECT_TRUE(cap.issuedWith(591, {"InLock", "Handled", "SIGTERM"})) << cap.log();
}

// Waits (state 7) with a recovery point that ends the thread; with
// g_disarmed it has already given the point up, as a thread does that is
// ending while the stop comes. g_order only makes the stopper's message
// visibly come before ours (a signal is no ordering the race detector sees).
pthread_mutex_t g_order = PTHREAD_MUTEX_INITIALIZER;
std::atomic<bool> g_disarmed{false}, g_release{false};
void waitingBody(klpThread* t) {
  klpThread::prologue(t);
  if (KLP_SET_RECOVERY_POINT(t->rcvyMgr) != 0) {
    pthread_mutex_lock(&g_order);
    pthread_mutex_unlock(&g_order);
    threadEnd(t, recoveryMgr::erRecover(&t->rcvyMgr, t));
  }
  if (g_disarmed) recoveryMgr::erUndoRecovery(&t->rcvyMgr);
  t->setState(KLP_THREAD_WAIT);
  for (int i = 0; i < 2000 && !g_release; ++i) hsvSleep(5);
  threadEnd(t, 0);
}

TEST_F(SigRecovery, StoppingAWaitingThreadSignalsItAndNeverEndsTheProcess) {
  // The thread blocks SIGINT and SIGTERM, as every created thread does.
  for (bool disarmed : {false, true}) {
    g_disarmed = disarmed;
    EXPECT_EQ(disarmed ? "stop=2009 end=2011 global=0\n" : "stop=2009 end=2009 global=15\n",
              child([] {
                recoveryMgr::erReinstall();
                erClearGlobalSignal();
                OrdList list("Threads");
                list.makeShared(nullptr, 1);
                int code = -1;
                klpThread* t =
                    createThread(&code, &list, waitingBody, "Waiter", nullptr, 1, nullptr, 0, 0);
                if (!thrtest::waitFor([&] { return t->getState() == KLP_THREAD_WAIT; })) return 91;
                pthread_mutex_lock(&g_order);
                int rc = klpThread::stop(t);  // withdrawn: on its way out, or still waiting
                pthread_mutex_unlock(&g_order);
                g_release = true;
                void* ret = nullptr;
                pthread_join(t->handle, &ret);
                printf("stop=%d end=%ld global=%d\n", rc,
                       static_cast<long>(reinterpret_cast<intptr_t>(ret)), erGetGlobalSignal());
                return 0;
              }));
  }
  EXPECT_TRUE(cap.issuedWith(591, {"Waiter", "Handled", "SIGTERM"})) << cap.log();
}

TEST_F(SigRecovery, ARestartedThreadStartsWithAFreshRecoveryState) {
  EXPECT_EQ("run 1 rc=2009\naction 5\nrun 2 rc=2009\nend code 2011\n", child([] {
              recoveryMgr::erReinstall();
              OrdList list("Threads");
              list.makeShared(nullptr, 1);
              int code = -1;
              klpThread* t =
                  createThread(&code, &list, restartedBody, "Again", nullptr, 1, nullptr, 0, 0);
              auto ended = [&] { return t->getState() == KLP_THREAD_STOP; };
              if (!thrtest::waitFor(ended)) return 91;
              int highest = 0;
              supervise(&list, 0, &highest);  // starts it again
              if (!thrtest::waitFor([&] { return g_run == 2 && ended(); })) return 92;
              printf("end code %d\n", t->getEndCode());
              klpThread::stop(t);
              return 0;
            }));
}

TEST_F(SigRecovery, QueueResourcesDestroyOrDetachTheirQueue) {
  std::string path = cap.dir() + "RCVY.TEST.IPC";
  for (bool destroy : {true, false}) {
    EXPECT_EQ("queue pointer cleared\nend=2009 code=2009 global=2\n", child([&] {
                HSVResID id;
                if (hsvIPCGetQueResID(path.c_str(), HSV_QUEUE_RESID_OPTION, &id) != 0) return 92;
                g_queue = new HSVHIPCQueue;
                if (g_queue->create(id, HSV_MAX_MSG_SIZE, HSV_CREATE_OPTION) != 0) return 93;
                g_destroyQueue = destroy;
                return runThread(queueBody, "QueueUser");
              }));
    EXPECT_EQ(!destroy, klptest::queueExists(path)) << (destroy ? "destroy" : "detach");
  }
  HSVResID id;  // leave nothing behind
  hsvIPCGetQueResID(path.c_str(), HSV_QUEUE_RESID_OPTION, &id);
  HSVHIPCQueue q;
  ASSERT_EQ(0u, q.attach(id));
  q.destroy();
  EXPECT_FALSE(klptest::queueExists(path));
  char ref[24];
  snprintf(ref, sizeof ref, "%016" PRIx64, reinterpret_cast<uint64_t>(&g_queue));
  EXPECT_TRUE(cap.issuedWith(595, {ref})) << cap.log();
  EXPECT_TRUE(cap.issuedWith(593, {ref})) << cap.log();
  EXPECT_TRUE(cap.has("<erHSVIPCQdestroy>")) << cap.log();
}

// A fault is never recovered: whether the thread has a recovery point or
// not, the process ends by the fault (its core as usual) after one line on
// standard error, with no message, no dump and no clean-up run.
int g_fault = 0;
void faultingBody(klpThread* t) {
  klpThread::prologue(t);
  addRcvyRes(action, 9);
  if (KLP_SET_RECOVERY_POINT(t->rcvyMgr) != 0) say("recovered\n");
  raise(g_fault);
  say("carried on\n");
}

TEST_F(SigRecovery, AFaultEndsTheProcessWithATrapLineOnly) {
  struct {
    int sig;
    bool registered;
  } rows[] = {{SIGSEGV, true}, {SIGBUS, true}, {SIGILL, true}, {SIGSEGV, false}};
  for (const auto& row : rows) {
    SCOPED_TRACE(row.sig);
    g_fault = row.sig;
    auto c = thrtest::inChild(cap.dir(), [&] {
      struct rlimit none = {0, 0};
      setrlimit(RLIMIT_CORE, &none);
      if (chdir(cap.dir().c_str()) != 0) return 94;  // where a dump would go
      if (row.registered) return runThread(faultingBody, "Faulty");
      recoveryMgr::erReinstall();
      std::thread raw([] { raise(g_fault); });
      raw.join();
      return 0;
    });
    EXPECT_FALSE(c.exited) << c.out;
    EXPECT_EQ(row.sig, c.signal);
    EXPECT_EQ("", thrtest::withoutMessages(c.out));
    std::string line = "KLP trap: signal " + std::to_string(row.sig) + " (";
    EXPECT_NE(std::string::npos, c.err.find(line)) << c.err;
    EXPECT_EQ(row.registered, c.err.find("(Faulty)") != std::string::npos) << c.err;
  }
  EXPECT_TRUE(cap.issued(591).empty()) << cap.log();
  for (const auto& entry : std::filesystem::directory_iterator(cap.dir()))
    EXPECT_EQ(std::string::npos, entry.path().string().find(".DUMP")) << entry.path();
}

TEST(RecoveryDump, NamedDirPrefixPidTidAppendedAndEndingWithTheMarker) {
  thrtest::LogCapture cap;
  auto endsWithMarker = [](const std::string& content) {
    static const std::string marker("***E**O**D**M***\0", 17);
    return content.size() >= marker.size() &&
           content.compare(content.size() - marker.size(), marker.size(), marker) == 0;
  };
  std::string dir = cap.dir().substr(0, cap.dir().size() - 1);
  std::string ids = "." + std::to_string(hsvProcessID()) + "." + std::to_string(hsvThreadID()) + ".DUMP";
  char path[1200];
  ASSERT_EQ(0, erDumpStackTraceTo(dir.c_str(), "S1", SIGSEGV, nullptr, nullptr, path, sizeof path));
  EXPECT_EQ(dir + "/S1" + ids, path);
  std::string first = klptest::readFile(path);
  EXPECT_TRUE(endsWithMarker(first));
  // A second dump of the same thread is appended.
  ASSERT_EQ(0, erDumpStackTraceTo(dir.c_str(), "S1", SIGSEGV, nullptr, nullptr));
  std::string both = klptest::readFile(path);
  EXPECT_GT(both.size(), first.size());
  EXPECT_EQ(0, both.compare(0, first.size(), first));
  EXPECT_TRUE(endsWithMarker(both));
  EXPECT_TRUE(cap.issuedWith(8053, {"SIGSEGV", path})) << cap.log();
  // A blank prefix is left out; a file that cannot be opened is 803.
  ASSERT_EQ(0, erDumpStackTraceTo(dir.c_str(), "   ", 8, nullptr, nullptr, path, sizeof path));
  EXPECT_EQ(dir + "/" + ids, path);
  EXPECT_EQ(KLP_RC_DUMP_FILE,
            erDumpStackTraceTo((dir + "/missing/dir").c_str(), "S1", 8, nullptr, nullptr));
  EXPECT_TRUE(cap.issuedWith(589, {"erDumpStackTraceInfo", "803", "HSVTrapFile::isValid"}))
      << cap.log();
  EXPECT_EQ(KLP_RC_DUMP_FILE,
            erDumpStackTraceTo(std::string(2000, 'd').c_str(), "S1", 8, nullptr, nullptr));
}

TEST(Recovery, ResourcesNeedARegisteredThreadAndCanBeDropped) {
  thrtest::mainReady();
  thrtest::LogCapture cap;
  int rc = 0;
  std::thread other([&] { rc = addRcvyRes(action, 0) == nullptr ? 1 : 0; });
  other.join();
  EXPECT_EQ(1, rc);
  EXPECT_TRUE(cap.issuedWith(589, {"addRcvyRes", "602", "findRcvyMgr"})) << cap.log();

  recoveryRes* r = addRcvyRes(action, 7);
  ASSERT_NE(nullptr, r);
  EXPECT_STREQ("KlpRcvyRes:", r->ole.eyeCatcher);
  EXPECT_EQ(&klpMainThread()->rcvyMgr.resList, r->ole.oleAnchor);
  EXPECT_GT(r->registered, 0);
  endRcvyRes(r);
  EXPECT_EQ(0, klpMainThread()->rcvyMgr.resList.count);
}

// ---------------------------------------------------------------------------
// Control interface calls and ending signals
// ---------------------------------------------------------------------------
std::atomic<int> g_callerSaw{0};
void callerHandler(int sig) { g_callerSaw = sig; }
std::atomic<bool> g_inCall{false};

// One guarded call: a clean-up registered, then a SIGINT from `from`, the
// call's own thread or another thread of the caller.
int guardedCall(bool fromOtherThread, char* text, size_t len) {
  erLibraryCall call;
  if (KLP_SET_CALL_POINT(call) != 0) return call.recover(text, len);
  recoveryRes* res = addRcvyRes(action, 4);
  if (fromOtherThread) {
    g_inCall = true;
    for (int i = 0; i < 2000; ++i) hsvSleep(5);
  } else {
    raise(SIGINT);
  }
  endRcvyRes(res);
  return 0;
}

TEST_F(SigRecovery, ASignalDuringALibraryCallEndsTheCallAndTheCallersHandlersComeBack) {
  struct {
    void (*handler)(int);
    bool fromOtherThread;
  } rows[] = {{callerHandler, false}, {SIG_IGN, false}, {SIG_DFL, false}, {callerHandler, true}};
  for (const auto& row : rows) {
    EXPECT_EQ("action 4\nrc=2010 restored\n", child([&] {
                signal(SIGINT, row.handler);
                std::thread other;
                if (row.fromOtherThread) other = std::thread([] {
                    thrtest::waitFor([] { return g_inCall.load(); });
                    raise(SIGINT);  // this thread is the caller's, in no call
                  });
                char text[1028];
                int rc = guardedCall(row.fromOtherThread, text, sizeof text);
                if (other.joinable()) other.join();
                if (std::string(text).find("SIGINT") == std::string::npos) return 95;
                struct sigaction now;
                sigaction(SIGINT, nullptr, &now);
                printf("rc=%d %s\n", rc, now.sa_handler == row.handler ? "restored" : "not restored");
                if (row.handler == callerHandler) {
                  raise(SIGINT);  // the caller's own handler takes it now
                  if (g_callerSaw != SIGINT) return 96;
                }
                return 0;
              }));
  }
}

TEST_F(SigRecovery, AnEndingSignalRunsTheCleanUpsThenEndsTheProcessByThatSignal) {
  for (int sig : {SIGHUP, SIGQUIT, SIGPIPE, SIGUSR1}) {
    auto c = thrtest::inChild(cap.dir(), [sig] {
      struct rlimit none = {0, 0};
      setrlimit(RLIMIT_CORE, &none);
      recoveryMgr::erReinstall();
      erCatchEndingSignals();
      klpThread* m = klpMainThread();
      if (KLP_SET_RECOVERY_POINT(m->rcvyMgr) != 0) {
        recoveryMgr::erRecover(&m->rcvyMgr, m);
        return 97;  // not reached: the signal ends the process
      }
      addRcvyRes(action, sig);
      kill(getpid(), sig);
      return 98;
    });
    EXPECT_EQ(sig, c.signal) << c.out;
    EXPECT_EQ("action " + std::to_string(sig) + "\n", thrtest::withoutMessages(c.out));
  }
}

}  // namespace
