#include "common/thread/klpthread.h"

#include <gtest/gtest.h>

#include <atomic>
#include <thread>
#include <vector>

#include "common/msg/klplog.h"
#include "common/platform/hsv.h"
#include "common/thread/queue.h"
#include "common/util/klprc.h"
#include "tests/testing/klptest.h"

namespace {

std::atomic<bool> g_release{false};  // W and H threads end when set
std::atomic<int> g_runs{0}, g_endWith{0}, g_seenState{0};
std::atomic<klpThread*> g_seenCurrent{nullptr};
sigset_t g_seenMask;
Queue g_queue;

// The body of every thread here, by the first letter of its name: E ends
// with g_endWith; A ends with 9 on its first run, 0 on the next; W works
// until released; H rests, not cancellable, until released; R waits on
// g_queue until cut off; D works on a connection until interrupted, then
// ends with 5; N returns without ending itself.
void body(klpThread* t) {
  klpThread::prologue(t);
  char k = t->name[0];
  int run = ++g_runs;
  if (k == 'N') return;
  if (k == 'E' || k == 'A') threadEnd(t, k == 'E' ? g_endWith.load() : run == 1 ? 9 : 0);
  if (k == 'W') {  // as a thread that ran before, still with its old end code
    t->setEndCode(g_endWith);
    g_seenState = t->getState();
    g_seenCurrent = currentThread();
    pthread_sigmask(SIG_BLOCK, nullptr, &g_seenMask);
    logKlpMsg(8006, "body", KLP_DEST_SEVERITY, "fromWorker", nullptr, 0);
  }
  if (k == 'H') pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, nullptr);
  klpDbConn* c = k == 'D' ? t->connect('O', "DB1", 1208) : nullptr;
  t->setState(k == 'W' || k == 'D' ? KLP_THREAD_RUN : KLP_THREAD_REST);
  for (int32_t wait = 60000; k == 'R'; wait = 60000) g_queue.getHeadWithWait(&wait);
  while (!g_release && !(c && __atomic_load_n(&c->interrupts, __ATOMIC_RELAXED))) hsvSleep(2);
  threadEnd(t, c ? 5 : 0);
}

bool waitState(klpThread* t, int32_t s) { return klptest::waitFor([&] { return t->getState() == s; }); }
bool onIdList(klpThread* t) { return t->tid.oleAnchor == klpThreadIdList(); }

// Real threads on a shared list, with the main thread registered first.
struct MtThread : ::testing::Test {
  klptest::TmpDir tmp;
  OrdList list{"Threads"};
  int highest = 3;
  void SetUp() override {
    klptest::mainThreadReady();
    g_release = false;
    g_runs = 0;
    list.makeShared(nullptr, 1);
  }
  klpThread* make(const char* name, int restart = 1, int critical = 0, int shared = 0) {
    int code = -1;
    klpThread* t = createThread(&code, &list, body, name, "MYDB", restart,
                                name[0] == 'W' ? malloc(8) : nullptr, shared, critical);
    EXPECT_EQ(0, code);
    return t;
  }
};

TEST_F(MtThread, ACreatedThreadRunsAsTheCurrentThreadUnderItsName) {
  klptest::LogRecords records(tmp.path());
  klpThread* t = make("Worker");
  ASSERT_TRUE(waitState(t, KLP_THREAD_RUN));
  EXPECT_TRUE(g_seenCurrent == t && g_seenState == KLP_THREAD_INIT && onIdList(t));
  // Sent to the process, SIGINT and SIGTERM are the main thread's; a stop must still reach it.
  EXPECT_TRUE(sigismember(&g_seenMask, SIGINT) && sigismember(&g_seenMask, SIGTERM));
  EXPECT_FALSE(sigismember(&g_seenMask, erStopSignal()));
  EXPECT_TRUE(threadStateByName(&list, "Worker") == KLP_THREAD_RUN && !threadStateByName(&list, "Work"));
  EXPECT_STREQ("Worker", t->cmdList->qName);
  EXPECT_TRUE(t->cmdList->locked && t->cmdList->ownerCheck());
  EXPECT_EQ(0, strncmp(t->dbCtx.dbAlias, "MYDB    ", 8));
  g_release = true;
  ASSERT_TRUE(waitState(t, KLP_THREAD_STOP));
  EXPECT_EQ(KLP_RC_THREAD_ENDED, t->getEndCode());  // 0 is stored as 2011
  EXPECT_TRUE(t->userData == nullptr && !onIdList(t));  // an ended thread's id may be reused
  EXPECT_EQ(KLP_RC_THREAD_ENDED, klpThread::stop(t));
  std::vector<std::string> got = records.take(true);  // the logger names the issuing thread
  EXPECT_EQ("Worker>8006|body|1|fromWorker", got.empty() ? "" : got[0]);
}

// Two threads run their first prologue at once; exits 0 when exactly one of
// them took the process's first prologue. The first to take it is held at
// the thread-id list's lock meanwhile, so the other surely comes by.
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
  _exit((strcmp(a.name, "Initial") == 0) + (strcmp(b.name, "Initial") == 0) == 1 && ids->count == 2 ? 0 : 1);
}

TEST(KlpThreadFirst, OnlyOneOfTwoThreadsAtOnceTakesTheFirstPrologue) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");  // a process where no prologue ran yet
  EXPECT_EXIT(firstPrologueRace(), ::testing::ExitedWithCode(0), "");
}

TEST_F(MtThread, StopRemovesAnEndedThreadEndsAWorkingOneAndWithdrawsOneItMustCutOff) {
  klptest::LogRecords records(tmp.path());
  struct { const char* name; int32_t ready; int rc; const char* log; } rows[] = {  // ready: stopped in
      {"Ender", KLP_THREAD_STOP, 77, "590|klpThread::stop|1|Initial|77|Ender"},  // its end code
      {"NoEnd", KLP_THREAD_STOP, 2011, "590|klpThread::stop|1|Initial|2011|NoEnd"},  // returned
      {"DbWorker", KLP_THREAD_RUN, 5, "590|klpThread::stop|1|Initial|0|DbWorker"},  // interrupted
      {"Rester", KLP_THREAD_REST, 2009, "590|klpThread::stop|1|Initial|0|Rester"},  // withdrawn
  };
  g_endWith = 77;
  OrdListElement pending[2];  // other threads' commands on the shared list
  for (OrdListElement& e : pending) klpSharedCmdList()->putTail(&e);
  for (const auto& row : rows) {
    klpThread* t = make(row.name, 1, 0, row.name[0] == 'N');
    ASSERT_TRUE(waitState(t, row.ready)) << row.name;
    EXPECT_EQ(row.rc, klpThread::stop(t)) << row.name;
    EXPECT_EQ(row.rc == KLP_RC_RECOVERED, list.count) << row.name;
    EXPECT_EQ(std::vector<std::string>{row.log}, records.take());
  }
  OrdList* s = klpSharedCmdList();  // locked, owner checked; a stop empties a thread's own list only
  EXPECT_TRUE(s->count == 2 && s->locked && s->ownerCheck() && !strcmp(s->qName, "KlpList"));
  for (OrdListElement& e : pending) EXPECT_EQ(&e, klpSharedCmdList()->getHead());
  klpThread* t = klpThreadOf(list.olHead);
  EXPECT_TRUE(t->ole.withdrawn && !list.browseHead() && !threadStateByName(&list, "Rester"));
  void* ret = nullptr;
  pthread_join(t->handle, &ret);
  EXPECT_TRUE(ret == PTHREAD_CANCELED && !onIdList(t));
  OrdListElement x;  // the queue it waited on is as it was: unlocked, no waiter, no post left
  g_queue.putTailAndNotify(&x);
  int32_t wait = 1000;
  EXPECT_EQ(&x, g_queue.getHeadWithWait(&wait));
  EXPECT_TRUE(g_queue.waiters == 0 && g_queue.waitpost.wait(0) == ECF_TIMEOUT);
  t->setState(KLP_THREAD_STOP);  // gone: now it can be removed
  t->hasHandle = 0;
  klpThread::stop(t);
}

// After a failed stop, stop all rests a while: shown as resting (state 5)
// unless the thread waits for its database (8), and its state comes back.
TEST_F(MtThread, StopAllToleratesOnlyAnUnstoppableHoldLThreadAndRestsAfterAFailure) {
  EXPECT_EQ(0, stopAll(nullptr));
  for (const char* name : {"HoldLThread", "HoldOn"}) {
    g_release = false;
    klpThread *hold = make(name), *done = make("Ended"), *m = klpMainThread();
    ASSERT_TRUE(waitState(hold, KLP_THREAD_REST) && waitState(done, KLP_THREAD_STOP));
    int32_t before = name[4] == 'L' ? KLP_THREAD_RUN : KLP_THREAD_DBWAIT;
    m->setState(before);
    std::atomic<bool> rested{false}, stopped{false};
    std::thread watcher([&] {
      for (; !stopped; hsvSleep(1)) rested = rested || m->getState() == KLP_THREAD_REST;
    });
    EXPECT_EQ(name[4] == 'L' ? 0 : KLP_RC_RECOVERED, stopAll(&list)) << name;
    stopped = true;
    watcher.join();
    EXPECT_TRUE(rested == (before == KLP_THREAD_RUN) && m->getState() == before);
    m->setState(KLP_THREAD_RUN);
    EXPECT_TRUE(hold->ole.withdrawn && list.count == 1);  // only the withdrawn one is left
    g_release = true;
    ASSERT_TRUE(waitState(hold, KLP_THREAD_STOP));
    EXPECT_EQ(KLP_RC_THREAD_ENDED, klpThread::stop(hold));
  }
}

TEST_F(MtThread, SupervisionJudgesTheSetRestartsAndRemoves) {
  // Threads by name as body ("!" critical, "-" no restart), their end code, the stopping flag,
  // per pass the result and the threads left, the highest end code from 3.
  struct { std::vector<const char*> threads; int endWith, stopping; std::vector<std::pair<int, int>> passes;
           int highest; } rows[] = {
      {{}, 0, 0, {{2007, 0}}, 3},
      {{"W"}, 0, 0, {{415, 1}}, 3},                 // alive, none critical
      {{"W", "W!"}, 0, 0, {{0, 2}}, 3},             // a critical one lives
      {{"W!", "E-"}, 9, 0, {{2006, 1}}, 9},         // one finished
      {{"E"}, 2001, 0, {{2007, 1}, {2007, 0}}, 3},  // 2001: kept one pass (as 2011)
      {{"A"}, 0, 0, {{415, 1}, {2007, 0}}, 3},      // restarted after 9, removed after 0
      {{"W", "E-"}, 2012, 0, {{2012, 1}}, 2012},    // a shutdown
      {{"E-"}, 2012, 0, {{2012, 0}}, 2012},
      {{"E"}, 9, 1, {{2007, 0}}, 9},                // stopping: not restarted
      {{"W!"}, 7, 0, {{0, 1}}, 3},                  // a live critical one's code counts
      {{"W!"}, 7, 1, {{0, 1}}, 7},                  // only while stopping, and not 2001
      {{"W!"}, 2001, 1, {{0, 1}}, 3},
  };
  EXPECT_EQ(0, supervise(nullptr, 0, &highest));
  for (const auto& row : rows) {
    SCOPED_TRACE(row.threads.size() ? row.threads.back() : "none");
    g_release = false;
    g_runs = 0;
    g_endWith = row.endWith;
    highest = 3;
    for (const char* n : row.threads) make(n, n[1] != '-', n[1] == '!');
    for (auto [rc, left] : row.passes) {
      for (OrdListElement* e = list.browseHead(); e; e = OrdList::browsePrev(e))  // W runs, others end
        ASSERT_TRUE(waitState(klpThreadOf(e), klpThreadOf(e)->name[0] == 'W' ? KLP_THREAD_RUN : 6));
      EXPECT_TRUE(supervise(&list, row.stopping, &highest) == rc && list.count == left) << rc;
    }
    EXPECT_EQ(row.highest, highest);
    g_release = true;
    for (OrdListElement* e; (e = list.browseHead()) != nullptr; klpThread::stop(klpThreadOf(e)))
      ASSERT_TRUE(waitState(klpThreadOf(e), KLP_THREAD_STOP));
  }
  EXPECT_EQ(1, g_runs.load());
}

TEST(KlpThread, ConnectionLookupCreatesOnlyForKindOAndAStopInterruptsTheWorkInProgress) {
  klpThread t;
  klpDbConn* o = t.getThrdCtlConn('O', "ORCL", 1208);
  EXPECT_TRUE(o && o == t.getThrdCtlConn('O', "ORCL", 1208) && o != t.getThrdCtlConn('O', "ORCL", 819));
  EXPECT_EQ(nullptr, t.getThrdCtlConn('D', "SAMPLE", 1208));
  klpDbConn* d = t.connect('D', "SAMPLE", 1208);
  EXPECT_EQ(d, t.getThrdCtlConn('D', "SAMPLE", 1208));
  t.interruptDbWork();  // the current connection
  t.detachCurrentConn();
  t.interruptDbWork();  // none: the database context
  EXPECT_TRUE(d->interrupts == 1 && t.dbCtx.interrupts == 1);
  t.cleanupConns();  // the sanitizer build reports a leak if one is left
}

}  // namespace
