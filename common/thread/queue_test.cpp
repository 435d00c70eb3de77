#include "common/thread/queue.h"

#include <gtest/gtest.h>

#include <thread>
#include <vector>

#include "common/thread/klpthread.h"
#include "common/util/klprc.h"
#include "tests/testing/klptest.h"

namespace {

struct Rec {
  QueueElement qe;
  int id;
  Rec(int i, int prio) : id(i) { qe.priority = prio; }
};
int idOf(OrdListElement* e) { return e ? reinterpret_cast<Rec*>(e)->id : 0; }

int32_t waitersOf(Queue& q) {
  q.lk.lock();
  int32_t n = q.waiters;
  q.lk.unlock("Queue");
  return n;
}

// Takes everything without waiting: the ids in the order they came, from
// the head ('h') or the tail ('t') as `ends` says.
std::string drain(Queue& q, const char* ends) {
  std::string out;
  for (const char* end = ends; *end; ++end) {
    int32_t wait = 0;
    out += std::to_string(idOf(*end == 'h' ? q.getHeadWithWait(&wait) : q.getTailWithWait(&wait)));
  }
  return out;
}

TEST(Queue, TakesFollowTheEndsAndThePrioritiesWithoutWaiting) {
  struct {
    const char* puts;  // per element 1, 2, 3: T putTail, H putHead, or a priority digit
    const char* ends;
    const char* order;
  } rows[] = {
      {"TTH", "thtt", "2310"},  // 3 1 2 from the head; then empty: none
      {"HHH", "hhh", "321"},
      {"535", "hhh", "231"},    // ascending from the head, the last of equal ones first
      {"194", "hhh", "132"},
      {"355", "ttt", "231"},
  };
  for (const auto& row : rows) {
    Queue q;
    std::vector<Rec> recs;
    for (int i = 0; i < 3; ++i) recs.emplace_back(i + 1, row.puts[i] - '0');
    for (int i = 0; i < 3; ++i) {
      char p = row.puts[i];
      if (p == 'T') q.putTailAndNotify(&recs[i].qe.ole);
      else if (p == 'H') q.putHeadAndNotify(&recs[i].qe.ole);
      else q.putHeadWithPriorityAndNotify(&recs[i].qe);
    }
    EXPECT_EQ(row.order, drain(q, row.ends)) << row.puts;
    EXPECT_TRUE(q.count == 0 && !q.head && !q.tail) << row.puts;
    EXPECT_TRUE(!recs[0].qe.ole.olePrev && !recs[0].qe.ole.oleNext) << row.puts;
    // Nobody waited: every put was an idle post, no post was made.
    EXPECT_EQ(3, q.idlePosts);
    EXPECT_EQ(ECF_TIMEOUT, q.waitpost.wait(0));
  }
}

TEST(Queue, AWaitTakesAtOnceWhenItNeedNotWaitAndTimesOutOnAnEmptyQueue) {
  Queue q;
  for (int32_t wait : {0, -5}) {
    EXPECT_EQ(nullptr, q.getHeadWithWait(&wait));
    EXPECT_EQ(0, wait);
  }
  Rec a(1, 0);
  q.putTailAndNotify(&a.qe.ole);
  int32_t wait = 5000;
  EXPECT_EQ(1, idOf(q.getTailWithWait(&wait)));
  EXPECT_EQ(0, wait);
  EXPECT_EQ(1, q.immediateTakes);
  wait = 100;
  EXPECT_EQ(nullptr, q.getHeadWithWait(&wait));
  EXPECT_EQ(1, q.timeouts);
  EXPECT_EQ(0, q.wakeups);
  EXPECT_GT(wait, 0);
  EXPECT_EQ(wait, q.timeoutTime);
  EXPECT_EQ(0, q.waiters);
}

TEST(Queue, StatisticsPrintWholeNumberAveragesAndAFailingWaitPostIsNamed) {
  klptest::TmpDir tmp;
  auto c = klptest::inChild(tmp.path(), [] {
    Queue q;
    q.printStats();  // nothing yet: averages stay 0
    q.wakeupTime = 7;
    q.wakeups = 2;
    q.timeoutTime = 2500;
    q.timeouts = 1;
    q.printStats();
    q.wakeups = 0;  // the previous average stays
    q.printStats();
    // The object gone: a wait fails (no statistic changes), a post for a
    // waiter fails.
    q.waitpost.destroy();
    int32_t wait = 100;
    if (q.getHeadWithWait(&wait) != nullptr || q.timeouts != 1 || q.waiters != 0) return 1;
    q.waiters = 1;
    Rec a(1, 0);
    q.putTailAndNotify(&a.qe.ole);
    q.waiters = 0;
    return 0;
  });
  EXPECT_EQ(0, c.exitCode);
  EXPECT_EQ("<=== wakeup stats: 0 / 0 = 0.00000, timeout stats:     0 / 0 = 0.00000 ===>\n"
            "<=== wakeup stats: 7 / 2 = 3.00000, timeout stats:     2500 / 1 = 2500.00000 ===>\n"
            "<=== wakeup stats: 7 / 0 = 3.00000, timeout stats:     2500 / 1 = 2500.00000 ===>\n"
            "Error from HSVHIPCWaitpost::wait -1879047169: ECF_WAITPOST_NOT_INITIALIZED\n"
            "Post WAITPOST_NOT_INITIALIZED\n",
            c.out);
}

// ---------------------------------------------------------------------------
// With real threads
// ---------------------------------------------------------------------------
TEST(MtQueue, WaitingConsumersAreWokenOncePerPutAndNoWakeUpIsLost) {
  // Rows: consumers waiting, and whether another takes the first element
  // before the woken consumer comes (the consumer must then wait on).
  struct {
    int consumers;
    bool stolen;
  } rows[] = {{1, false}, {2, false}, {1, true}};
  for (const auto& row : rows) {
    Queue q;
    std::vector<int> got(row.consumers);
    std::vector<std::thread> consumers;
    for (int c = 0; c < row.consumers; ++c)
      consumers.emplace_back([&, c] {
        int32_t wait = 60000;
        got[c] = idOf(q.getHeadWithWait(&wait));
      });
    ASSERT_TRUE(klptest::waitFor([&] { return waitersOf(q) == row.consumers; }));
    Rec a(1, 0), b(2, 0);
    q.lk.lock();  // both puts (and posts) before any consumer takes
    q.putTailAndNotify(&a.qe.ole);
    if (row.stolen) {
      int32_t none = 0;
      EXPECT_EQ(1, idOf(q.getHeadWithWait(&none)));
      q.lk.unlock("Queue");
      hsvSleep(50);  // not needed for the verdict: lets the consumer find the queue empty
      q.lk.lock();
    }
    if (row.consumers == 2 || row.stolen) q.putTailAndNotify(&b.qe.ole);
    q.lk.unlock("Queue");
    for (auto& t : consumers) t.join();
    int sum = 0;
    for (int id : got) sum += id;
    EXPECT_EQ(row.stolen ? 2 : row.consumers == 2 ? 3 : 1, sum);
    EXPECT_EQ(row.consumers, q.wakeups);
    EXPECT_EQ(0, q.timeouts + q.idlePosts + q.waiters);
    EXPECT_LT(q.wakeupTime, 60000);
  }
}

// Waits on the queue as a resting thread until it is stopped.
Queue* g_stopQueue = nullptr;
void queueWaiter(klpThread* t) {
  klpThread::prologue(t);
  t->setState(KLP_THREAD_REST);
  for (;;) {
    int32_t wait = 60000;
    g_stopQueue->getHeadWithWait(&wait);
  }
}

TEST(MtQueue, StoppingAThreadThatWaitsLeavesTheQueueAsItWas) {
  klptest::mainThreadReady();
  klptest::TmpDir tmp;
  // A hang is the fault: the child is given up after its time-out.
  auto c = klptest::inChild(tmp.path(), [] {
    Queue q;
    g_stopQueue = &q;
    OrdList list("Threads");
    list.makeShared(nullptr, 1);
    int code = -1;
    klpThread* t = createThread(&code, &list, queueWaiter, "QWaiter", nullptr, 1, nullptr, 0, 0);
    if (!klptest::waitFor([&] { return waitersOf(q) == 1; })) return 91;
    if (klpThread::stop(t) != KLP_RC_RECOVERED) return 92;  // cancelled: never reached state 6
    pthread_join(t->handle, nullptr);
    if (waitersOf(q) != 0) return 93;
    Rec a(1, 0);
    q.putTailAndNotify(&a.qe.ole);
    int32_t wait = 1000;
    if (idOf(q.getHeadWithWait(&wait)) != 1) return 94;
    if (q.waitpost.wait(0) != ECF_TIMEOUT || q.waitpost.post() != 0) return 95;
    return 0;
  }, 10000);
  EXPECT_EQ(0, c.exitCode) << c.out;
}

}  // namespace
