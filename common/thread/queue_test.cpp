#include "common/thread/queue.h"

#include <gtest/gtest.h>

#include <atomic>
#include <thread>
#include <vector>

#include "common/thread/thread_testutil.h"

namespace {

struct Rec {
  QueueElement qe;
  int id;
  Rec(int i, int prio) : id(i) { qe.priority = prio; }
};
int idOf(OrdListElement* e) { return e ? reinterpret_cast<Rec*>(e)->id : -1; }

int32_t waitersOf(Queue& q) {
  q.lk.lock();
  int32_t n = q.waiters;
  q.lk.unlock("Queue");
  return n;
}

TEST(Queue, WithoutWaitAnEmptyQueueAnswersNullAtOnce) {
  Queue q;
  int32_t wait = 0;
  EXPECT_EQ(nullptr, q.getHeadWithWait(&wait));
  EXPECT_EQ(0, wait);
  wait = -5;
  EXPECT_EQ(nullptr, q.getTailWithWait(&wait));
  EXPECT_EQ(0, wait);
  EXPECT_EQ(0, q.immediateTakes);
}

TEST(Queue, ANonEmptyQueueIsAnImmediateTake) {
  Queue q;
  Rec a(1, 0);
  q.putTailAndNotify(&a.qe.ole);
  int32_t wait = 5000;
  EXPECT_EQ(1, idOf(q.getHeadWithWait(&wait)));
  EXPECT_EQ(0, wait);
  EXPECT_EQ(1, q.immediateTakes);
  EXPECT_EQ(0, q.count);
  EXPECT_EQ(nullptr, q.head);
  EXPECT_EQ(nullptr, q.tail);
}

TEST(Queue, HeadAndTailPutsAndGetsKeepTheirEnds) {
  Queue q;
  Rec a(1, 0), b(2, 0), c(3, 0);
  q.putTailAndNotify(&a.qe.ole);  // a
  q.putTailAndNotify(&b.qe.ole);  // a b
  q.putHeadAndNotify(&c.qe.ole);  // c a b
  EXPECT_EQ(3, q.count);
  int32_t w = 0;
  EXPECT_EQ(2, idOf(q.getTailWithWait(&w)));
  EXPECT_EQ(3, idOf(q.getHeadWithWait(&w)));
  EXPECT_EQ(1, idOf(q.getTailWithWait(&w)));
  EXPECT_EQ(nullptr, q.getTailWithWait(&w));
  EXPECT_EQ(nullptr, a.qe.ole.olePrev);
  EXPECT_EQ(nullptr, a.qe.ole.oleNext);
}

TEST(Queue, PrioritiesComeOutAscendingAndTheLastEqualOneFirst) {
  Queue q;
  Rec first5(1, 5), three(2, 3), second5(3, 5);
  q.putHeadWithPriorityAndNotify(&first5.qe);
  q.putHeadWithPriorityAndNotify(&three.qe);
  q.putHeadWithPriorityAndNotify(&second5.qe);
  int32_t w = 0;
  EXPECT_EQ(2, idOf(q.getHeadWithWait(&w)));
  EXPECT_EQ(3, idOf(q.getHeadWithWait(&w)));
  EXPECT_EQ(1, idOf(q.getHeadWithWait(&w)));
}

TEST(Queue, ALowestPriorityBecomesTheTail) {
  Queue q;
  Rec a(1, 1), b(2, 9), c(3, 4);
  q.putHeadWithPriorityAndNotify(&a.qe);
  q.putHeadWithPriorityAndNotify(&b.qe);  // ranks after everything
  q.putHeadWithPriorityAndNotify(&c.qe);
  int32_t w = 0;
  EXPECT_EQ(2, idOf(q.getTailWithWait(&w)));
  EXPECT_EQ(1, idOf(q.getHeadWithWait(&w)));
  EXPECT_EQ(3, idOf(q.getHeadWithWait(&w)));
}

TEST(Queue, APutWithNobodyWaitingIsAnIdlePost) {
  Queue q;
  Rec a(1, 0), b(2, 0);
  q.putTailAndNotify(&a.qe.ole);
  q.putHeadAndNotify(&b.qe.ole);
  EXPECT_EQ(2, q.idlePosts);
  EXPECT_EQ(0, q.wakeups);
  // No post was made: a wait now times out instead of waking at once.
  EXPECT_EQ(ECF_TIMEOUT, q.waitpost.wait(20));
}

TEST(Queue, AWaitEndsByTimeOutWithItsStatistics) {
  Queue q;
  int32_t wait = 300;
  EXPECT_EQ(nullptr, q.getHeadWithWait(&wait));
  EXPECT_EQ(1, q.timeouts);
  EXPECT_EQ(0, q.wakeups);
  EXPECT_GE(wait, 280);  // it did wait (the clock may round a little)
  EXPECT_LT(wait, 5000);
  EXPECT_EQ(wait, q.timeoutTime);
  EXPECT_EQ(0, q.waiters);
}

TEST(Queue, AveragesAreWholeNumbers) {
  thrtest::LogCapture cap;
  auto c = thrtest::inChild(cap.dir(), [] {
    Queue q;
    q.printStats();  // nothing yet: averages stay 0
    q.wakeupTime = 7;
    q.wakeups = 2;
    q.timeoutTime = 2500;
    q.timeouts = 1;
    q.printStats();
    q.wakeups = 0;  // the previous average stays
    q.printStats();
    return q.avgWakeup == 3.0 ? 0 : 1;
  });
  ASSERT_TRUE(c.exited);
  EXPECT_EQ(0, c.exitCode);
  EXPECT_NE(std::string::npos,
            c.out.find("<=== wakeup stats: 0 / 0 = 0.00000, timeout stats:     0 / 0 = 0.00000 "
                       "===>\n"))
      << c.out;
  EXPECT_NE(std::string::npos,
            c.out.find("<=== wakeup stats: 7 / 2 = 3.00000, timeout stats:     2500 / 1 = "
                       "2500.00000 ===>\n"))
      << c.out;
  EXPECT_NE(std::string::npos, c.out.find("<=== wakeup stats: 7 / 0 = 3.00000,")) << c.out;
}

// ---------------------------------------------------------------------------
// With real threads
// ---------------------------------------------------------------------------
TEST(MtQueue, AWaitingConsumerIsWokenByAPost) {
  Queue q;
  OrdListElement* got = nullptr;
  int32_t wait = 8000;
  std::thread consumer([&] { got = q.getHeadWithWait(&wait); });
  ASSERT_TRUE(thrtest::waitFor([&] { return waitersOf(q) == 1; }));
  Rec a(7, 0);
  q.putTailAndNotify(&a.qe.ole);
  consumer.join();
  EXPECT_EQ(7, idOf(got));
  EXPECT_EQ(1, q.wakeups);
  EXPECT_EQ(0, q.timeouts);
  EXPECT_EQ(0, q.idlePosts);
  EXPECT_EQ(wait, q.wakeupTime);
  EXPECT_LT(wait, 8000);
  EXPECT_EQ(0, q.waiters);
}

TEST(MtQueue, ProducersAndWaitingConsumersLoseNothing) {
  Queue q;
  constexpr int kEach = 500;
  std::vector<Rec*> all;
  for (int i = 0; i < 2 * kEach; ++i) all.push_back(new Rec(i, i % 7));
  std::atomic<int> taken{0};
  std::atomic<long> sum{0};
  std::vector<std::thread> ts;
  for (int p = 0; p < 2; ++p)
    ts.emplace_back([&, p] {
      for (int i = 0; i < kEach; ++i) {
        Rec* r = all[p * kEach + i];
        if (i % 3 == 0)
          q.putHeadWithPriorityAndNotify(&r->qe);
        else if (i % 3 == 1)
          q.putHeadAndNotify(&r->qe.ole);
        else
          q.putHeadWithPriorityAndNotify(&r->qe);
      }
    });
  for (int c = 0; c < 2; ++c)
    ts.emplace_back([&, c] {
      for (int rounds = 0; taken < 2 * kEach && rounds < 100000; ++rounds) {
        int32_t wait = 20;
        OrdListElement* e = c ? q.getHeadWithWait(&wait) : q.getTailWithWait(&wait);
        if (e) {
          sum += idOf(e);
          ++taken;
        }
      }
    });
  for (auto& t : ts) t.join();
  EXPECT_EQ(2 * kEach, taken.load());
  EXPECT_EQ(static_cast<long>(2 * kEach) * (2 * kEach - 1) / 2, sum.load());
  EXPECT_EQ(0, q.count);
  for (Rec* r : all) delete r;
}

}  // namespace
