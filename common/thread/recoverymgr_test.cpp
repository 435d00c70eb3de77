#include "common/thread/recoverymgr.h"

#include <gtest/gtest.h>
#include <sys/resource.h>
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <filesystem>
#include <functional>
#include <string>
#include <thread>

#include "common/platform/hsv.h"
#include "common/thread/klpthread.h"
#include "common/util/klprc.h"
#include "tests/testing/klptest.h"

// The recovery handler issues its messages from within the signal handler,
// as the design asks; the signals of these tests are raised synchronously by
// the receiving thread itself.
extern "C" const char* __tsan_default_options() { return "report_signal_unsafe=0"; }

namespace {

using Logs = std::vector<std::string>;

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

bool endsWithMarker(const std::string& content) {
  static const std::string marker("***E**O**D**M***\0", 17);
  return content.size() >= 17 && content.compare(content.size() - 17, 17, marker) == 0;
}

// Every routine of the folder that reports, with the records it logs
// (number, origin, destination kind, values in order); the signal handler's
// own are in the signal table below.
TEST(ThreadRecords, EachRoutineLogsItsRecords) {
  klptest::mainThreadReady();
  klptest::TmpDir tmp;
  klptest::LogRecords records(tmp.path());
  char owner[32];
  snprintf(owner, sizeof owner, "Initial:0x%08x",
           static_cast<unsigned>(reinterpret_cast<uintptr_t>(klpMainThread()) & 0xFFFFFFFFu));
  std::string dir = tmp.path() + "d", ids = std::to_string(hsvProcessID()) + "." +
                                             std::to_string(hsvThreadID()) + ".DUMP";
  std::filesystem::create_directory(dir);
  auto report = [](int sig, int global) {
    return [sig, global] {
      recoveryMgr m;
      m.signal = sig;
      erClearGlobalSignal();
      recoveryMgr::erWhatSignal(&m);
      EXPECT_EQ(global, erGetGlobalSignal()) << sig;
      erClearGlobalSignal();
    };
  };
  struct Row {
    const char* what;
    std::function<void()> run;
    Logs logs;
  } rows[] = {
      {"interest in code 64", [] { klpThread t; interestedInCmd(&t, 64); },
       {"8006|klpThread::interestedInCmd|1|64"}},
      {"interest in code -1 set", [] { klpThread t; setCmdInterest(&t, -1, 1); },
       {"8006|klpThread::setCmdInterest|1|-1"}},
      {"unlock by a thread that does not hold the lock", [] {
         OrdList l("Guarded");
         l.makeShared(nullptr, 1);
         l.lockList();
         std::thread([&] { l.unlockList(); }).join();
         l.unlockList();
       },
       {std::string("624|OrdList::unlock|1|UNKNOWN|Guarded|0|Thread does not hold lock|") + owner + "|1"}},
      {"dechain of a broken chain: unlinked all the same", [] {
         OrdList l("Broken");
         OrdListElement a, b, c;
         for (OrdListElement* e : {&a, &b, &c}) l.putTail(e);
         b.oleNext = nullptr;  // the head-side neighbour is lost
         EXPECT_EQ(0, ordListDeChain(&b));
         EXPECT_TRUE(l.count == 2 && !b.oleAnchor && !b.olePrev && !c.oleNext);
       },
       {"8000|ordListDeChain|1|KlpOLE:|Broken"}},
      {"stop of an ended thread", [] {
         OrdList list("Threads");
         list.makeShared(nullptr, 1);
         int code = 0;
         klpThread* t = createThread(&code, &list, [](klpThread* self) {
           klpThread::prologue(self);
           threadEnd(self, 77);
         }, "Ender", nullptr, 1, nullptr, 0, 0);
         ASSERT_TRUE(klptest::waitFor([&] { return t->getState() == KLP_THREAD_STOP; }));
         EXPECT_EQ(77, klpThread::stop(t));
       },
       {"590|klpThread::stop|1|Initial|77|Ender"}},
      {"resource for a thread that is not registered",
       [] { std::thread([] { EXPECT_EQ(nullptr, addRcvyRes(action, 0)); }).join(); },
       {"589|findRcvyMgr|1|findRcvyMgr|602|findThread", "589|addRcvyRes|1|addRcvyRes|602|findRcvyMgr"}},
      {"report of SIGINT", report(SIGINT, SIGINT), {"591|recoveryMgr::erWhatSignal|1|Initial|Handled|SIGINT"}},
      {"report of SIGTERM", report(SIGTERM, SIGTERM),
       {"591|recoveryMgr::erWhatSignal|1|Initial|Handled|SIGTERM"}},
      {"report of SIGFPE", report(SIGFPE, 0), {"591|recoveryMgr::erWhatSignal|1|Initial|Handled|SIGFPE"}},
      {"report of SIGILL", report(SIGILL, 0), {"591|recoveryMgr::erWhatSignal|1|Initial|Handled|SIGILL"}},
      {"report of SIGSEGV", report(SIGSEGV, 0),
       {"569|recoveryMgr::erWhatSignal|1|SIGSEGV", "591|recoveryMgr::erWhatSignal|1|Initial|Handled|SIGSEGV"}},
      {"report of SIGBUS", report(SIGBUS, 0), {"591|recoveryMgr::erWhatSignal|1|Initial|Non-handled|7"}},
      {"report of no signal", report(0, 0), {}},
      {"queue destroyed", [] { erHSVIPCQdestroy(0); }, {"595|erHSVIPCQdestroy|1|0000000000000000"}},
      {"queue detached", [] { erHSVIPCQdetach(0); }, {"593|erHSVIPCQdestroy|1|0000000000000000"}},
      {"dump, then one more appended", [&] {
         char path[1200];
         ASSERT_EQ(0, erDumpStackTraceTo(dir.c_str(), "S1", SIGSEGV, nullptr, nullptr, path, sizeof path));
         EXPECT_EQ(dir + "/S1." + ids, path);
         std::string first = klptest::readFile(path);
         EXPECT_TRUE(endsWithMarker(first));
         ASSERT_EQ(0, erDumpStackTraceTo(dir.c_str(), "S1", SIGSEGV, nullptr, nullptr));
         std::string both = klptest::readFile(path);
         EXPECT_TRUE(both.size() > first.size() && both.compare(0, first.size(), first) == 0);
         EXPECT_TRUE(endsWithMarker(both));
       },
       {"8053|erDumpStackTraceInfo|1|SIGSEGV|" + dir + "/S1." + ids,
        "8053|erDumpStackTraceInfo|1|SIGSEGV|" + dir + "/S1." + ids}},
      {"dump with a blank prefix", [&] { EXPECT_EQ(0, erDumpStackTraceTo(dir.c_str(), "  ", 8, nullptr, nullptr)); },
       {"8053|erDumpStackTraceInfo|1|SIGFPE|" + dir + "/." + ids}},
      {"dump file not opened", [&] {
         EXPECT_EQ(KLP_RC_DUMP_FILE, erDumpStackTraceTo((dir + "/no").c_str(), "S1", 8, nullptr, nullptr));
       },
       {"589|erDumpStackTraceInfo|1|erDumpStackTraceInfo|803|HSVTrapFile::isValid",
        "8999|erDumpStackTraceInfo|r8|" + dir + "/no/S1." + ids}},
      {"dump file name too long", [&] {
         EXPECT_EQ(KLP_RC_DUMP_FILE, erDumpStackTraceTo(std::string(2000, 'd').c_str(), "S1", 8, nullptr, nullptr));
       },
       {"589|erDumpStackTraceInfo|1|erDumpStackTraceInfo|803|HSVTrapFile::isValid",
        "8999|erDumpStackTraceInfo|r8|dump file name too long"}},
  };
  for (const Row& row : rows) {
    row.run();
    EXPECT_EQ(row.logs, records.take()) << row.what;
  }
}

TEST(Recovery, ResourcesBelongToTheCurrentThreadAndQueueActionsEndTheirQueue) {
  klptest::mainThreadReady();
  klptest::TmpDir tmp;
  recoveryRes* r = addRcvyRes(action, 7);
  ASSERT_NE(nullptr, r);
  EXPECT_STREQ("KlpRcvyRes:", r->ole.eyeCatcher);
  EXPECT_EQ(&klpMainThread()->rcvyMgr.resList, r->ole.oleAnchor);
  EXPECT_GT(r->registered, 0);
  endRcvyRes(r);
  EXPECT_EQ(0, klpMainThread()->rcvyMgr.resList.count);
  std::string path = tmp.path() + "RCVY.TEST.IPC";
  HSVResID id;
  ASSERT_EQ(0u, hsvIPCGetQueResID(path.c_str(), HSV_QUEUE_RESID_OPTION, &id));
  for (void (*act)(uint64_t) : {erHSVIPCQdetach, erHSVIPCQdestroy}) {
    HSVHIPCQueue* q = new HSVHIPCQueue;
    ASSERT_EQ(0u, act == erHSVIPCQdetach ? q->create(id, HSV_MAX_MSG_SIZE, HSV_CREATE_OPTION) : q->attach(id));
    act(reinterpret_cast<uint64_t>(&q));
    EXPECT_EQ(nullptr, q);
    EXPECT_EQ(act == erHSVIPCQdetach, klptest::queueExists(path));
  }
}

// ---------------------------------------------------------------------------
// Signals, in forked children: the handler jumps, threads end and the
// process-wide record changes, none of which may touch the test process.
// ---------------------------------------------------------------------------

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
}

// First run: a signal, so it ends with 2009 and supervision starts it
// again. Second run: a resource, then a signal at which the resource must
// run as on any first return.
std::atomic<int> g_run{0};
void restartedBody(klpThread* t) {
  klpThread::prologue(t);
  int run = ++g_run;
  if (KLP_SET_RECOVERY_POINT(t->rcvyMgr) != 0) {
    printf("run %d rc=%d\n", run, recoveryMgr::erRecover(&t->rcvyMgr, t));
    fflush(stdout);
    threadEnd(t, run == 1 ? KLP_RC_RECOVERED : 0);
  }
  if (run == 2) addRcvyRes(action, 5);
  raiseHere(SIGINT);
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

// A fault is never recovered, whether the thread has a recovery point or not.
int g_fault = 0;
void faultingBody(klpThread* t) {
  klpThread::prologue(t);
  addRcvyRes(action, 9);
  if (KLP_SET_RECOVERY_POINT(t->rcvyMgr) != 0) say("recovered\n");
  raise(g_fault);
  say("carried on\n");
}

klpThread* startThread(OrdList& list, klpThreadRoutine body, const char* name) {
  recoveryMgr::erReinstall();
  erClearGlobalSignal();
  list.makeShared(nullptr, 1);
  int code = -1;
  return createThread(&code, &list, body, name, nullptr, 1, nullptr, 0, 0);
}

// Starts a thread, waits for it and prints how it ended.
int runThread(klpThreadRoutine body, const char* name) {
  OrdList list("Threads");
  klpThread* t = startThread(list, body, name);
  void* ret = nullptr;
  pthread_join(t->handle, &ret);
  printf("end=%ld code=%d global=%d\n", static_cast<long>(reinterpret_cast<intptr_t>(ret)),
         t->getEndCode(), erGetGlobalSignal());
  return 0;
}

// The thread-id list must be free again for the others.
int listFree() {
  klpThreadIdList()->lockList();
  klpThreadIdList()->unlockList();
  say("list free\n");
  return 0;
}

int stopWaiter() {
  OrdList list("Threads");
  klpThread* t = startThread(list, waitingBody, "Waiter");
  if (!klptest::waitFor([&] { return t->getState() == KLP_THREAD_WAIT; })) return 91;
  pthread_mutex_lock(&g_order);
  int rc = klpThread::stop(t);  // withdrawn: on its way out, or still waiting
  pthread_mutex_unlock(&g_order);
  g_release = true;
  void* ret = nullptr;
  pthread_join(t->handle, &ret);
  printf("stop=%d end=%ld global=%d\n", rc, static_cast<long>(reinterpret_cast<intptr_t>(ret)),
         erGetGlobalSignal());
  return 0;
}

std::atomic<int> g_callerSaw{0};
void callerHandler(int sig) { g_callerSaw = sig; }
std::atomic<bool> g_inCall{false};

// One guarded call of the control interface with a clean-up registered,
// then a SIGINT on the call's own thread or on another thread of the caller;
// the caller's handler must come back afterwards.
int libraryCall(void (*handler)(int), bool fromOtherThread) {
  signal(SIGINT, handler);
  std::thread other;
  if (fromOtherThread) other = std::thread([] {
      klptest::waitFor([] { return g_inCall.load(); });
      raise(SIGINT);  // this thread is the caller's, in no call
    });
  char text[1028] = "";
  int rc = [&] {
    erLibraryCall call;
    if (KLP_SET_CALL_POINT(call) != 0) return call.recover(text, sizeof text);
    recoveryRes* res = addRcvyRes(action, 4);
    g_inCall = true;
    if (fromOtherThread)
      for (int i = 0; i < 2000; ++i) hsvSleep(5);
    else
      raise(SIGINT);
    endRcvyRes(res);
    return 0;
  }();
  if (other.joinable()) other.join();
  struct sigaction now;
  sigaction(SIGINT, nullptr, &now);
  printf("rc=%d %s %s\n", rc, now.sa_handler == handler ? "restored" : "not restored",
         strstr(text, "SIGINT") ? "SIGINT" : text);
  if (handler == callerHandler) {
    raise(SIGINT);  // the caller's own handler takes it now
    if (g_callerSaw != SIGINT) return 96;
  }
  return 0;
}

struct SigRecovery : ::testing::Test {
  void SetUp() override { klptest::mainThreadReady(); }
  klptest::TmpDir tmp;
  klptest::LogRecords records{tmp.path()};
};

TEST_F(SigRecovery, ASignalComesBackToTheThreadsRecoveryPointWithItsCleanUps) {
  const Logs once = {"591|recoveryMgr::erWhatSignal|1|InLock|Handled|SIGINT"};
  struct {
    const char* what;
    std::function<int()> body;
    const char* out;
    Logs logs;
  } rows[] = {
      {"resources last first, once; the fourth return ends the thread",
       [] { return runThread(signalledBody, "Signalled"); },
       "action 2\naction 1\nreturn 1 rc=2009 signal=2\nreturn 2 rc=2010 signal=2\n"
       "return 3 rc=2010 signal=2\nend=2010 code=2010 global=2\n",
       Logs(3, "591|recoveryMgr::erWhatSignal|1|Signalled|Handled|SIGINT")},
      {"a thread that is not registered, inside the thread-id list's lock", [] {
         recoveryMgr::erReinstall();
         pthread_t raw;
         pthread_create(&raw, nullptr, [](void*) -> void* {
           klpThreadIdList()->lockList();
           raise(SIGINT);
           return nullptr;
         }, nullptr);
         void* ret = nullptr;
         pthread_join(raw, &ret);
         printf("end=%ld\n", static_cast<long>(reinterpret_cast<intptr_t>(ret)));
         return listFree();
       },
       "end=2009\nlist free\n",
       {"589|findRcvyMgr|1|findRcvyMgr|602|findThread", "589|signalHandler|1|signalHandler|602|findRcvyMgr",
        "591|signalHandler|1|Unknown|Non-handled|2"}},
      {"a registered thread without recovery point", [] { return runThread(pointlessBody, "NoPoint"); },
       "action 7\nend=2009 code=2009 global=2\n",
       {"589|signalHandler|1|signalHandler|2009|setRecoveryPoint",
        "8999|signalHandler|r8|the thread has no recovery point", "591|signalHandler|1|NoPoint|Non-handled|SIGINT"}},
      {"inside the thread-id list's lock", [] {
         g_raise = SIGINT;
         return runThread(insideLockBody, "InLock") + listFree();
       },
       "end=2009 code=2009 global=2\nlist free\n", once},
      {"the stop's signal inside the lock: reported as SIGTERM", [] {
         g_raise = erStopSignal();
         return runThread(insideLockBody, "InLock") + listFree();
       },
       "end=2009 code=2009 global=15\nlist free\n",
       {"591|recoveryMgr::erWhatSignal|1|InLock|Handled|SIGTERM"}},
      {"stop of a waiting thread", [] { return stopWaiter(); }, "stop=2009 end=2009 global=15\n",
       {"590|klpThread::stop|1|Initial|0|Waiter", "591|recoveryMgr::erWhatSignal|1|Waiter|Handled|SIGTERM"}},
      {"stop of a waiting thread that gave its point up: never the process", [] {
         g_disarmed = true;
         return stopWaiter();
       },
       "stop=2009 end=2011 global=0\n", {"590|klpThread::stop|1|Initial|0|Waiter"}},
      {"a restarted thread starts with a fresh recovery state", [] {
         OrdList list("Threads");
         klpThread* t = startThread(list, restartedBody, "Again");
         auto ended = [&] { return t->getState() == KLP_THREAD_STOP; };
         if (!klptest::waitFor(ended)) return 91;
         int highest = 0;
         supervise(&list, 0, &highest);  // starts it again
         if (!klptest::waitFor([&] { return g_run == 2 && ended(); })) return 92;
         printf("end code %d\n", t->getEndCode());
         klpThread::stop(t);
         return 0;
       },
       "run 1 rc=2009\naction 5\nrun 2 rc=2009\nend code 2011\n",
       {"591|recoveryMgr::erWhatSignal|1|Again|Handled|SIGINT", "591|recoveryMgr::erWhatSignal|1|Again|Handled|SIGINT",
        "590|klpThread::stop|1|Initial|2011|Again"}},
      {"library call, caller's handler", [] { return libraryCall(callerHandler, false); },
       "action 4\nrc=2010 restored SIGINT\n", {}},
      {"library call, caller ignores", [] { return libraryCall(SIG_IGN, false); },
       "action 4\nrc=2010 restored SIGINT\n", {}},
      {"library call, caller's default", [] { return libraryCall(SIG_DFL, false); },
       "action 4\nrc=2010 restored SIGINT\n", {}},
      {"library call, signal on another thread of the caller",
       [] { return libraryCall(callerHandler, true); }, "action 4\nrc=2010 restored SIGINT\n", {}},
  };
  for (const auto& row : rows) {
    auto c = klptest::inChild(tmp.path(), row.body);
    EXPECT_EQ(0, c.exitCode) << row.what << "\n" << c.out;
    EXPECT_EQ(row.out, c.out) << row.what;
    EXPECT_EQ(row.logs, records.take()) << row.what;
  }
}

TEST_F(SigRecovery, FaultsEndTheProcessWithATrapLineAndEndingSignalsAfterTheCleanUps) {
  // A fault ends the process by itself (its core as usual) after one line on
  // standard error: no message, no dump, no clean-up. Any other signal whose
  // default ends the process runs the clean-ups first (erCatchEndingSignals).
  struct {
    int sig;
    int kind;  // 0 fault on a registered thread, 1 fault on a thread of no one, 2 ending signal
    std::string out;
    Logs logs;
  } rows[] = {
      {SIGSEGV, 0, "", {}}, {SIGBUS, 0, "", {}}, {SIGILL, 0, "", {}}, {SIGSEGV, 1, "", {}},
      {SIGHUP, 2, "action 1\n", {"591|recoveryMgr::erWhatSignal|1|Initial|Non-handled|1"}},
      {SIGQUIT, 2, "action 3\n", {"591|recoveryMgr::erWhatSignal|1|Initial|Non-handled|3"}},
      {SIGPIPE, 2, "action 13\n", {"591|recoveryMgr::erWhatSignal|1|Initial|Non-handled|13"}},
      {SIGUSR1, 2, "action 10\n", {"591|recoveryMgr::erWhatSignal|1|Initial|Non-handled|10"}},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.sig);
    g_fault = row.sig;
    auto c = klptest::inChild(tmp.path(), [&] {
      struct rlimit none = {0, 0};
      setrlimit(RLIMIT_CORE, &none);
      if (chdir(tmp.path().c_str()) != 0) return 94;  // where a dump would go
      if (row.kind == 0) return runThread(faultingBody, "Faulty");
      recoveryMgr::erReinstall();
      if (row.kind == 1) std::thread([] { raise(g_fault); }).join();
      erCatchEndingSignals();
      klpThread* m = klpMainThread();
      if (KLP_SET_RECOVERY_POINT(m->rcvyMgr) != 0) {
        recoveryMgr::erRecover(&m->rcvyMgr, m);
        return 97;  // not reached: the signal ends the process
      }
      addRcvyRes(action, row.sig);
      kill(getpid(), row.sig);
      return 98;
    });
    EXPECT_EQ(row.sig, c.signal);
    EXPECT_EQ(row.out, c.out);
    EXPECT_EQ(row.logs, records.take());
    std::string trap = "KLP trap: signal " + std::to_string(row.sig) + " (";
    EXPECT_EQ(row.kind < 2, c.err.find(trap) != std::string::npos) << c.err;
    EXPECT_EQ(row.kind == 0, c.err.find("(Faulty)") != std::string::npos) << c.err;
  }
  for (const auto& entry : std::filesystem::directory_iterator(tmp.path()))
    EXPECT_EQ(std::string::npos, entry.path().string().find(".DUMP")) << entry.path();
}

}  // namespace
