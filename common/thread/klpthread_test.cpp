#include "common/thread/klpthread.h"

#include <gtest/gtest.h>

#include <atomic>
#include <cstdlib>
#include <thread>
#include <vector>

#include "common/msg/klplog.h"
#include "common/platform/hsv.h"
#include "common/util/klprc.h"
#include "tests/testing/klptest.h"

namespace {

// What the thread bodies of a test look at.
std::atomic<bool> g_release{false};  // the bodies that wait end when set
std::atomic<int> g_runs{0};
std::atomic<int> g_endWith{0};  // end code of the "end" body
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
  threadEnd(t, ++g_runs == 1 ? 9 : 0);
}

// Returns without ending itself.
void returningBody(klpThread* t) { klpThread::prologue(t); }

bool waitState(klpThread* t, int32_t s) {
  return klptest::waitFor([&] { return t->getState() == s; });
}

bool onIdList(klpThread* t) { return t->tid.oleAnchor == klpThreadIdList(); }

// A thread that could not be stopped stays on its list, withdrawn: take it
// off and free it once it is really gone.
void reapWithdrawn(klpThread* t) {
  if (t->hasHandle) pthread_join(t->handle, nullptr);
  ordListDeChain(&t->ole);
  ordListDeChain(&t->tid);
  if (t->cmdList && t->cmdList != t->sharedCmdList) delete t->cmdList;
  delete t;
}

TEST(KlpThread, ANewThreadHasItsNameCutDefaultInterestsAndPrintsItself) {
  klptest::TmpDir tmp;
  auto c = klptest::inChild(tmp.path(), [] {
    klpThread t;
    t.setName("BehinderWorkerThread");
    if (strcmp(t.name, "BehinderWorker") != 0 || strcmp(t.ole.eyeCatcher, "KlpThrd") != 0 ||
        strcmp(t.tid.eyeCatcher, "KlpThID") != 0 || t.tid.object != &t || t.restart != 1)
      return 1;
    for (int code = -1; code <= KLP_CMD_CODES; ++code)
      if (interestedInCmd(&t, code) != (code == 14 || code == 18 || code == 19)) return 2;
    setCmdInterest(&t, 20, 7);
    setCmdInterest(&t, 64, 1);
    if (interestedInCmd(&t, 20) != 7) return 3;
    t.endCode = 42;
    klpThread::print(&t);
    t.restart = 0;
    klpThread::print(&t);
    return 0;
  });
  EXPECT_EQ(0, c.exitCode);
  EXPECT_EQ("klpThread::print  Thread with name BehinderWorker and state 1 and RC 42 and RESTART TRUE"
            " and handle  0000000000000000\n"
            "klpThread::print  Thread with name BehinderWorker and state 1 and RC 42 and RESTART FALSE"
            " and handle  0000000000000000\n",
            c.out);
}

// Real threads on a shared list, with the main thread registered first.
struct MtThread : ::testing::Test {
  klptest::TmpDir tmp;
  OrdList list{"Threads"};
  int highest = 3;
  void SetUp() override {
    klptest::mainThreadReady();
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
};

TEST_F(MtThread, TheMainThreadIsInitialAndEndsTheProcessWith12Or0) {
  klpThread* m = klpMainThread();
  EXPECT_STREQ("Initial", m->name);
  EXPECT_EQ(KLP_THREAD_RUN, m->getState());
  EXPECT_EQ(m, currentThread());
  EXPECT_STREQ("KlpThreadIDList", klpThreadIdList()->qName);
  EXPECT_EQ(1, klpThreadIdList()->locked);
  EXPECT_EQ(0, klpThreadIdList()->ownerCheck());
  EXPECT_EQ(klpSharedCmdList(), m->sharedCmdList);
  for (int end : {5, 0}) {
    auto c = klptest::inChild(tmp.path(), [end] {
      threadEnd(klpMainThread(), end);
      return 99;
    });
    EXPECT_TRUE(c.exited);
    EXPECT_EQ(end ? 12 : 0, c.exitCode);
  }
}

TEST_F(MtThread, ACreatedThreadRunsAsTheCurrentThreadUnderItsName) {
  klptest::LogRecords records(tmp.path());
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
  EXPECT_EQ(1, t->cmdList->ownerCheck());
  EXPECT_TRUE(onIdList(t));
  g_release = true;
  ASSERT_TRUE(waitState(t, KLP_THREAD_STOP));
  EXPECT_EQ(KLP_RC_THREAD_ENDED, t->getEndCode());  // 0 is stored as 2011
  EXPECT_EQ(KLP_RC_THREAD_ENDED, klpThread::stop(t));
  EXPECT_EQ(0, list.count);
  // The logger names the thread that issued the message.
  std::vector<std::string> got = records.take(true);
  ASSERT_FALSE(got.empty());
  EXPECT_EQ("Worker>8006|workBody|1|fromWorker", got[0]);
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
  EXPECT_EQ(KLP_RC_THREAD_ENDED, klpThread::stop(t));
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

TEST_F(MtThread, StopRemovesAnEndedThreadEndsAWorkingOneAndWithdrawsOneItMustCutOff) {
  struct {
    klpThreadRoutine body;
    const char* name;
    int32_t ready;  // the state the thread is stopped in
    int endWith;
    int rc;
  } rows[] = {
      {endBody, "Ender", KLP_THREAD_STOP, 77, 77},    // nothing to end: its end code
      {dbBody, "DbWorker", KLP_THREAD_RUN, 0, 5},     // its database work interrupted, it ends
      {restBody, "Rester", KLP_THREAD_REST, 0, 2009},  // cut off: withdrawn
  };
  for (const auto& row : rows) {
    g_endWith = row.endWith;
    klpThread* t = make(row.body, row.name);
    ASSERT_TRUE(waitState(t, row.ready)) << row.name;
    EXPECT_EQ(row.rc, klpThread::stop(t)) << row.name;
    if (row.rc != KLP_RC_RECOVERED) {
      EXPECT_EQ(0, list.count) << row.name;
      continue;
    }
    EXPECT_EQ(1, t->ole.withdrawn);
    EXPECT_EQ(nullptr, list.browseHead());
    EXPECT_EQ(0, threadStateByName(&list, "Rester"));
    void* ret = nullptr;
    ASSERT_EQ(0, pthread_join(t->handle, &ret));
    t->hasHandle = 0;
    EXPECT_EQ(PTHREAD_CANCELED, ret);
    EXPECT_FALSE(onIdList(t));  // an ended thread's id may be reused
    reapWithdrawn(t);
  }
}

TEST_F(MtThread, StopAllToleratesOnlyAnUnstoppableHoldLThread) {
  EXPECT_EQ(0, stopAll(nullptr));
  for (const char* name : {"HoldLThread", "HoldOn"}) {
    g_release = false;
    klpThread* hold = make(holdBody, name);
    klpThread* done = make(endBody, "Done");
    ASSERT_TRUE(waitState(hold, KLP_THREAD_REST));
    ASSERT_TRUE(waitState(done, KLP_THREAD_STOP));
    EXPECT_EQ(std::string(name) == "HoldLThread" ? 0 : KLP_RC_RECOVERED, stopAll(&list)) << name;
    EXPECT_EQ(1, hold->ole.withdrawn);
    EXPECT_EQ(1, list.count);  // only the withdrawn one is left
    g_release = true;
    reapWithdrawn(hold);
  }
}

TEST_F(MtThread, SupervisionJudgesTheSetRestartsAndRemoves) {
  enum Kind { kWork, kEnd, kTwice };
  struct Spec {
    Kind kind;
    int critical, restart;
  };
  struct Pass {
    int rc, left;
  };
  struct {
    const char* what;
    std::vector<Spec> threads;
    int endWith, stopping;
    std::vector<Pass> passes;
    int highest;  // from 3
  } rows[] = {
      {"none", {}, 0, 0, {{2007, 0}}, 3},
      {"live, none critical", {{kWork, 0, 1}}, 0, 0, {{415, 1}}, 3},
      {"a critical one lives", {{kWork, 0, 1}, {kWork, 1, 1}}, 0, 0, {{0, 2}}, 3},
      {"one finished", {{kWork, 1, 1}, {kEnd, 0, 0}}, 9, 0, {{2006, 1}}, 9},
      {"2001: kept one pass", {{kEnd, 0, 1}}, 2001, 0, {{2007, 1}, {2007, 0}}, 3},
      {"restarted after 9", {{kTwice, 0, 1}}, 0, 0, {{415, 1}, {2007, 0}}, 3},
      {"shutdown", {{kWork, 0, 1}, {kEnd, 0, 0}}, 2012, 0, {{2012, 1}}, 2012},
      {"shutdown, none alive", {{kEnd, 0, 0}}, 2012, 0, {{2012, 0}}, 2012},
      {"stopping: not restarted", {{kEnd, 0, 1}}, 9, 1, {{2007, 0}}, 9},
  };
  EXPECT_EQ(0, supervise(nullptr, 0, &highest));
  for (const auto& row : rows) {
    SCOPED_TRACE(row.what);
    g_release = false;
    g_runs = 0;
    g_endWith = row.endWith;
    highest = 3;
    std::vector<klpThread*> ts;
    for (const Spec& s : row.threads)
      ts.push_back(make(s.kind == kWork ? workBody : s.kind == kEnd ? endBody : restartBody, "T",
                        s.restart, s.critical));
    for (const Pass& pass : row.passes) {
      for (size_t i = 0; i < ts.size(); ++i)
        ASSERT_TRUE(!ts[i] || waitState(ts[i], row.threads[i].kind == kWork ? KLP_THREAD_RUN : KLP_THREAD_STOP));
      EXPECT_EQ(pass.rc, supervise(&list, row.stopping, &highest));
      EXPECT_EQ(pass.left, list.count);
      for (klpThread*& t : ts) {  // forget the ones removed (and freed)
        bool kept = false;
        for (OrdListElement* e = list.olHead; e; e = e->olePrev) kept = kept || e == &t->ole;
        if (!kept) t = nullptr;
      }
    }
    EXPECT_EQ(row.highest, highest);
    g_release = true;
    for (OrdListElement* e; (e = list.browseHead()) != nullptr;) {
      ASSERT_TRUE(waitState(klpThreadOf(e), KLP_THREAD_STOP));
      klpThread::stop(klpThreadOf(e));
    }
  }
  EXPECT_EQ(1, g_runs.load());  // the 2001 one never ran again
}

TEST_F(MtThread, SleepingShowsRestingUnlessWaitingForDb) {
  klpThread* m = klpMainThread();
  for (int32_t before : {KLP_THREAD_RUN, KLP_THREAD_DBWAIT}) {
    m->setState(before);
    std::atomic<int> seen{0};
    std::thread watcher([&] {
      klptest::waitFor([&] { return m->getState() != before; }, 1000);
      seen = m->getState();
    });
    klpRestingSleep(300);
    watcher.join();
    EXPECT_EQ(before == KLP_THREAD_RUN ? KLP_THREAD_REST : KLP_THREAD_DBWAIT, seen.load());
    EXPECT_EQ(before, m->getState());  // restored
  }
  m->setState(KLP_THREAD_RUN);
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
