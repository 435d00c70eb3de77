#include "common/thread/klpthread.h"

#include <gtest/gtest.h>

#include <atomic>
#include <cstdlib>

#include "common/thread/thread_testutil.h"
#include "common/util/klprc.h"

namespace {

// What the thread bodies of a test look at.
std::atomic<bool> g_release{false};    // the bodies that wait end when set
std::atomic<int> g_runs{0};
std::atomic<int> g_endWith{0};         // end code of the "end" body
std::atomic<klpThread*> g_seenCurrent{nullptr};
std::atomic<int> g_seenState{0};
sigset_t g_seenMask;

// Ends at once with g_endWith.
void endBody(klpThread* t) {
  klpThread::prologue(t);
  ++g_runs;
  threadEnd(t, g_endWith);
}

// Runs (state 4) until released, then ends with 0.
void workBody(klpThread* t) {
  klpThread::prologue(t);
  g_seenState = t->getState();
  g_seenCurrent = currentThread();
  pthread_sigmask(SIG_BLOCK, nullptr, &g_seenMask);
  logKlpMsg(8006, "workBody", KLP_DEST_SEVERITY, "fromWorker", nullptr, 0);
  t->setState(KLP_THREAD_RUN);
  while (!g_release) hsvSleep(2);
  threadEnd(t, 0);
}

// Rests in short sleeps, never ending by itself (but cancellable).
void restBody(klpThread* t) {
  klpThread::prologue(t);
  t->setState(KLP_THREAD_REST);
  for (;;) hsvSleep(5);
}

// Rests and cannot be cancelled: unstoppable until released.
void holdBody(klpThread* t) {
  klpThread::prologue(t);
  pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, nullptr);
  t->setState(KLP_THREAD_REST);
  while (!g_release) hsvSleep(5);
  threadEnd(t, 0);
}

// Works on a connection and ends with 5 once its work is interrupted.
void dbBody(klpThread* t) {
  klpThread::prologue(t);
  klpDbConn* c = t->connect('O', "DB1", 1208);
  t->setState(KLP_THREAD_RUN);
  for (int i = 0; i < 2000 && __atomic_load_n(&c->interrupts, __ATOMIC_RELAXED) == 0; ++i)
    hsvSleep(5);
  threadEnd(t, 5);
}

// First run ends with 9 (to be restarted), the second with 0.
void restartBody(klpThread* t) {
  klpThread::prologue(t);
  int run = ++g_runs;
  threadEnd(t, run == 1 ? 9 : 0);
}

// Returns without ending itself.
void returningBody(klpThread* t) { klpThread::prologue(t); }

bool waitState(klpThread* t, int32_t s) {
  return thrtest::waitFor([&] { return t->getState() == s; });
}

// A thread that could not be stopped stays on its list, withdrawn: take it
// off and free it once it is really gone.
void reapWithdrawn(klpThread* t) {
  if (t->hasHandle) pthread_join(t->handle, nullptr);
  ordListDeChain(&t->ole);
  ordListDeChain(&t->tid);
  if (t->cmdList && t->cmdList != t->sharedCmdList) delete t->cmdList;
  delete t;
}

bool onIdList(klpThread* t) { return t->tid.oleAnchor == klpThreadIdList(); }

// Real threads on a shared list, with the main thread registered first.
struct MtThread : ::testing::Test {
  klpThread* mainThr = thrtest::mainReady();
  thrtest::LogCapture cap;
  OrdList list{"Threads"};
  int highest = 0;
  void SetUp() override {
    g_release = false;
    g_runs = 0;
    g_endWith = 0;
    list.makeShared(nullptr, 1);
  }
  klpThread* make(klpThreadRoutine body, const char* name, int restart = 1, int critical = 0,
                  void* userData = nullptr) {
    int code = -1;
    klpThread* t = createThread(&code, &list, body, name, nullptr, restart, userData, 0, critical);
    EXPECT_EQ(0, code);
    return t;
  }
  int supervise() { return ::supervise(&list, 0, &highest); }
};

TEST(KlpThread, NamesAreCutTo14AndNewThreadsWantStopResumeSuspend) {
  thrtest::LogCapture cap;
  klpThread t;
  t.setName("BehinderWorkerThread");
  EXPECT_STREQ("BehinderWorker", t.name);
  EXPECT_STREQ("KlpThrd", t.ole.eyeCatcher);
  EXPECT_STREQ("KlpThID", t.tid.eyeCatcher);
  EXPECT_EQ(&t, t.tid.object);
  EXPECT_EQ(KLP_THREAD_EXIST, t.state);
  EXPECT_EQ(1, t.restart);
  for (int code = 0; code < KLP_CMD_CODES; ++code)
    EXPECT_EQ(code == 14 || code == 18 || code == 19 ? 1 : 0, interestedInCmd(&t, code)) << code;
  EXPECT_EQ(0, interestedInCmd(&t, 64));
  EXPECT_EQ(0, interestedInCmd(&t, -1));
  setCmdInterest(&t, 64, 1);
  setCmdInterest(&t, 20, 1);
  EXPECT_EQ(1, interestedInCmd(&t, 20));
  EXPECT_TRUE(cap.issuedWith(8006, {"64"})) << cap.log();
  EXPECT_TRUE(cap.issuedWith(8006, {"-1"})) << cap.log();
  EXPECT_EQ(3u, cap.issued(8006).size());
}

TEST(KlpThread, PrintShowsNameStateCodeAndRestart) {
  thrtest::LogCapture cap;
  auto c = thrtest::inChild(cap.dir(), [] {
    klpThread t;
    t.setName("Printer");
    t.restart = 0;
    t.endCode = 42;
    klpThread::print(&t);
    return 0;
  });
  ASSERT_TRUE(c.exited);
  EXPECT_EQ("klpThread::print  Thread with name Printer and state 1 and RC 42 and RESTART FALSE"
            " and handle  0000000000000000\n",
            c.out);
}

TEST_F(MtThread, TheMainThreadIsInitialAndEndsTheProcessWith12Or0) {
  EXPECT_STREQ("Initial", mainThr->name);
  EXPECT_EQ(KLP_THREAD_RUN, mainThr->getState());
  EXPECT_EQ(mainThr, currentThread());
  EXPECT_STREQ("KlpThreadIDList", klpThreadIdList()->qName);
  EXPECT_EQ(1, klpThreadIdList()->locked);
  EXPECT_EQ(0, klpThreadIdList()->ownerCheck());
  EXPECT_EQ(klpSharedCmdList(), mainThr->sharedCmdList);
  for (int end : {5, 0}) {
    auto c = thrtest::inChild(cap.dir(), [end] {
      threadEnd(klpMainThread(), end);
      return 99;
    });
    EXPECT_TRUE(c.exited);
    EXPECT_EQ(end ? 12 : 0, c.exitCode);
  }
}

TEST_F(MtThread, ACreatedThreadRunsAsTheCurrentThreadUnderItsName) {
  void* data = malloc(64);  // freed by the thread's end
  klpThread* t = make(workBody, "Worker", 1, 0, data);
  ASSERT_NE(nullptr, t);
  ASSERT_TRUE(waitState(t, KLP_THREAD_RUN));
  EXPECT_EQ(t, g_seenCurrent.load());
  EXPECT_EQ(KLP_THREAD_INIT, g_seenState.load());
  // Sent to the process, SIGINT and SIGTERM are the main thread's; a stop
  // must still reach the thread.
  EXPECT_TRUE(sigismember(&g_seenMask, SIGINT));
  EXPECT_TRUE(sigismember(&g_seenMask, SIGTERM));
  EXPECT_FALSE(sigismember(&g_seenMask, erStopSignal()));
  EXPECT_EQ(KLP_THREAD_RUN, threadStateByName(&list, "Worker"));
  EXPECT_EQ(0, threadStateByName(&list, "Work"));
  EXPECT_STREQ("Worker", t->cmdList->qName);
  EXPECT_EQ(1, t->cmdList->locked);
  EXPECT_TRUE(onIdList(t));
  EXPECT_EQ(1, list.count);
  g_release = true;
  ASSERT_TRUE(waitState(t, KLP_THREAD_STOP));
  EXPECT_EQ(KLP_RC_THREAD_ENDED, t->getEndCode());  // 0 is stored as 2011
  EXPECT_EQ(KLP_RC_THREAD_ENDED, klpThread::stop(t));
  EXPECT_EQ(0, list.count);
  // The logger names the thread that issued the message.
  std::string log = cap.log();
  size_t at = log.find("fromWorker");
  ASSERT_NE(std::string::npos, at) << log;
  EXPECT_NE(std::string::npos, log.rfind("Worker\"", at)) << log;
}

TEST_F(MtThread, ABodyThatReturnsEndsAs2011AndItsStopLeavesTheSharedCommandsAlone) {
  OrdListElement* pending[2] = {new OrdListElement, new OrdListElement};
  for (OrdListElement* e : pending) klpSharedCmdList()->putTail(e);  // other threads' commands
  int code = -1;
  klpThread* t = createThread(&code, &list, returningBody, "Returner", "MYDB", 1, nullptr, 1, 0);
  ASSERT_EQ(0, code);
  EXPECT_EQ(klpSharedCmdList(), t->cmdList);
  EXPECT_EQ(0, strncmp(t->dbCtx.dbAlias, "MYDB    ", 8));
  ASSERT_TRUE(waitState(t, KLP_THREAD_STOP));
  EXPECT_EQ(KLP_RC_THREAD_ENDED, t->getEndCode());
  EXPECT_EQ(KLP_RC_THREAD_ENDED, klpThread::stop(t));
  EXPECT_EQ(1, klpSharedCmdList()->locked);
  EXPECT_EQ(2, klpSharedCmdList()->count);
  for (OrdListElement* e : pending) {
    EXPECT_EQ(e, klpSharedCmdList()->getHead());
    delete e;
  }
}

// Two threads run their first prologue at once; exits 0 when exactly one
// of them took the process's first prologue. The first to take it is held
// at the thread-id list's lock meanwhile, so the other surely comes by.
void firstPrologueRace() {
  OrdList* ids = klpThreadIdList();
  ids->makeShared("KlpThreadIDList", 0);
  ids->lockList();
  klpThread a, b;
  std::thread ta(klpThread::prologue, &a), tb(klpThread::prologue, &b);
  hsvSleep(200);  // not needed for the verdict: lets both threads come by
  ids->unlockList();
  ta.join();
  tb.join();
  int initial = (strcmp(a.name, "Initial") == 0) + (strcmp(b.name, "Initial") == 0);
  _exit(initial == 1 && ids->count == 2 ? 0 : 1);
}

TEST(KlpThreadFirst, OnlyOneOfTwoThreadsAtOnceTakesTheFirstPrologue) {
  // In a process of its own, where no prologue has run yet.
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(firstPrologueRace(), ::testing::ExitedWithCode(0), "");
}

TEST_F(MtThread, StopOfAnEndedThreadReturnsItsEndCodeAndRemovesIt) {
  g_endWith = 77;
  klpThread* t = make(endBody, "Ender");
  ASSERT_TRUE(waitState(t, KLP_THREAD_STOP));
  EXPECT_FALSE(onIdList(t));  // an ended thread's id may be reused
  EXPECT_EQ(77, klpThread::stop(t));
  EXPECT_EQ(0, list.count);
  EXPECT_EQ(nullptr, list.olHead);
  EXPECT_TRUE(cap.issuedWith(590, {"Initial", "77", "Ender"})) << cap.log();
}

TEST_F(MtThread, StopInterruptsTheDbWorkOfAWorkingThread) {
  klpThread* t = make(dbBody, "DbWorker");
  ASSERT_TRUE(waitState(t, KLP_THREAD_RUN));
  ASSERT_TRUE(thrtest::waitFor([&] { return t->getCurDbConn() != nullptr; }));
  EXPECT_EQ(5, klpThread::stop(t));  // it ended during the stop's wait
  EXPECT_EQ(0, list.count);
}

TEST_F(MtThread, AThreadThatCannotBeBroughtToAnEndIsWithdrawn) {
  klpThread* t = make(restBody, "Rester");
  ASSERT_TRUE(waitState(t, KLP_THREAD_REST));
  EXPECT_EQ(KLP_RC_RECOVERED, klpThread::stop(t));
  EXPECT_EQ(1, t->ole.withdrawn);
  EXPECT_EQ(1, list.count);
  EXPECT_EQ(nullptr, list.browseHead());
  EXPECT_EQ(0, threadStateByName(&list, "Rester"));
  void* ret = nullptr;
  ASSERT_EQ(0, pthread_join(t->handle, &ret));  // it was cancelled
  t->hasHandle = 0;
  EXPECT_EQ(PTHREAD_CANCELED, ret);
  EXPECT_FALSE(onIdList(t));
  reapWithdrawn(t);
}

TEST_F(MtThread, StopAllToleratesOnlyAnUnstoppableHoldLThread) {
  for (const char* name : {"HoldLThread", "HoldOn"}) {
    SCOPED_TRACE(name);
    g_release = false;
    klpThread* hold = make(holdBody, name);
    klpThread* done = make(endBody, "Done");
    ASSERT_TRUE(waitState(hold, KLP_THREAD_REST));
    ASSERT_TRUE(waitState(done, KLP_THREAD_STOP));
    EXPECT_EQ(std::string(name) == "HoldLThread" ? 0 : KLP_RC_RECOVERED, stopAll(&list));
    EXPECT_EQ(1, hold->ole.withdrawn);
    EXPECT_EQ(1, list.count);  // only the withdrawn one is left
    EXPECT_EQ(&hold->ole, list.olHead);
    g_release = true;
    reapWithdrawn(hold);
  }
}

TEST_F(MtThread, SupervisionSeesCriticalAndNonCriticalLiveThreads) {
  EXPECT_EQ(0, ::supervise(nullptr, 0, &highest));
  EXPECT_EQ(KLP_RC_NONE_ALIVE, supervise());
  klpThread* plain = make(workBody, "Plain");
  ASSERT_TRUE(waitState(plain, KLP_THREAD_RUN));
  EXPECT_EQ(KLP_RC_NO_CRITICAL, supervise());
  klpThread* crit = make(workBody, "Critical", 1, 1);
  ASSERT_TRUE(waitState(crit, KLP_THREAD_RUN));
  EXPECT_EQ(0, supervise());
  g_release = true;
  ASSERT_TRUE(waitState(plain, KLP_THREAD_STOP));
  ASSERT_TRUE(waitState(crit, KLP_THREAD_STOP));
  // Both ended with 0 (2011) and restart set: removed, nothing alive.
  EXPECT_EQ(KLP_RC_NONE_ALIVE, supervise());
  EXPECT_EQ(0, list.count);
}

TEST_F(MtThread, SupervisionReportsAFinishedThreadWhileOthersLive) {
  g_endWith = 9;
  klpThread* crit = make(workBody, "Critical", 1, 1);
  klpThread* gone = make(endBody, "Gone", 0);
  ASSERT_TRUE(waitState(crit, KLP_THREAD_RUN));
  ASSERT_TRUE(waitState(gone, KLP_THREAD_STOP));
  highest = 3;
  EXPECT_EQ(KLP_RC_THREAD_FINISHED, supervise());
  EXPECT_EQ(9, highest);
  EXPECT_EQ(1, list.count);
  g_release = true;
  ASSERT_TRUE(waitState(crit, KLP_THREAD_STOP));
  EXPECT_EQ(KLP_RC_THREAD_ENDED, klpThread::stop(crit));
}

TEST_F(MtThread, SupervisionKeepsA2001ThreadOnePassThenRemovesIt) {
  g_endWith = KLP_RC_TERMINATED;
  klpThread* t = make(endBody, "Terminated");
  ASSERT_TRUE(waitState(t, KLP_THREAD_STOP));
  EXPECT_EQ(KLP_RC_NONE_ALIVE, supervise());
  EXPECT_EQ(1, list.count);
  EXPECT_EQ(KLP_RC_THREAD_ENDED, t->getEndCode());
  EXPECT_EQ(KLP_RC_NONE_ALIVE, supervise());
  EXPECT_EQ(0, list.count);
  EXPECT_EQ(0, highest);
  EXPECT_EQ(1, g_runs.load());  // never started again
}

TEST_F(MtThread, SupervisionRestartsAThreadThatEndedWithAnotherCode) {
  klpThread* t = make(restartBody, "Restarted");
  ASSERT_TRUE(waitState(t, KLP_THREAD_STOP));
  ASSERT_EQ(9, t->getEndCode());
  EXPECT_EQ(KLP_RC_NO_CRITICAL, supervise());  // restarted: alive
  ASSERT_TRUE(thrtest::waitFor([&] { return g_runs == 2 && t->getState() == KLP_THREAD_STOP; }));
  EXPECT_EQ(KLP_RC_THREAD_ENDED, t->getEndCode());
  EXPECT_EQ(KLP_RC_NONE_ALIVE, supervise());  // 2011: removed
  EXPECT_EQ(0, list.count);
}

TEST_F(MtThread, SupervisionPassesOnAShutdownCode) {
  g_endWith = KLP_RC_SHUTDOWN;
  klpThread* t = make(endBody, "Shutdown", 0);
  ASSERT_TRUE(waitState(t, KLP_THREAD_STOP));
  EXPECT_EQ(KLP_RC_SHUTDOWN, supervise());
  EXPECT_EQ(KLP_RC_SHUTDOWN, highest);
  EXPECT_EQ(0, list.count);
}

TEST_F(MtThread, SleepingShowsRestingUnlessWaitingForDb) {
  std::atomic<int> seen{0};
  std::atomic<bool> sleeping{false};
  std::thread watcher([&] {
    thrtest::waitFor([&] { return sleeping.load(); });
    thrtest::waitFor([&] { return mainThr->getState() == KLP_THREAD_REST; }, 1000);
    seen = mainThr->getState();
  });
  sleeping = true;
  klpRestingSleep(300);
  watcher.join();
  EXPECT_EQ(KLP_THREAD_REST, seen.load());
  EXPECT_EQ(KLP_THREAD_RUN, mainThr->getState());  // restored
  mainThr->setState(KLP_THREAD_DBWAIT);
  klpRestingSleep(10);
  EXPECT_EQ(KLP_THREAD_DBWAIT, mainThr->getState());
  mainThr->setState(KLP_THREAD_RUN);
}

TEST(KlpThread, ConnectionLookupCreatesOnlyForKindO) {
  klpThread t;
  klpDbConn* o = t.getThrdCtlConn('O', "ORCL", 1208);
  ASSERT_NE(nullptr, o);
  EXPECT_EQ(o, t.getThrdCtlConn('O', "ORCL", 1208));
  EXPECT_NE(o, t.getThrdCtlConn('O', "ORCL", 819));  // another code page
  EXPECT_EQ(nullptr, t.getThrdCtlConn('D', "SAMPLE", 1208));
  klpDbConn* d = t.connect('D', "SAMPLE", 1208);
  EXPECT_EQ(d, t.getThrdCtlConn('D', "SAMPLE", 1208));
  EXPECT_EQ(0, t.interruptDbWork());  // the current connection
  EXPECT_EQ(1, d->interrupts);
  t.detachCurrentConn();
  EXPECT_EQ(0, t.interruptDbWork());  // none: the database context
  EXPECT_EQ(1, t.dbCtx.interrupts);
  t.cleanupConns();  // the sanitizer build reports a leak if one is left
  EXPECT_EQ(nullptr, t.conns);
}

}  // namespace
