#include "common/thread/queue.h"

#include <gtest/gtest.h>

#include <atomic>
#include <thread>
#include <vector>

#include "common/thread/thread_testutil.h"
#include "common/util/klprc.h"

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

TEST(Queue, AnEmptyQueueWithoutWaitIsNullAtOnceANonEmptyOneAnImmediateTake) {
  Queue q;
  for (int32_t wait : {0, -5}) {
    EXPECT_EQ(nullptr, wait ? q.getTailWithWait(&wait) : q.getHeadWithWait(&wait));
    EXPECT_EQ(0, wait);
  }
  EXPECT_EQ(0, q.immediateTakes);
  Rec a(1, 0);
  q.putTailAndNotify(&a.qe.ole);
  int32_t wait = 5000;
  EXPECT_EQ(1, idOf(q.getHeadWithWait(&wait)));
  EXPECT_EQ(0, wait);
  EXPECT_EQ(1, q.immediateTakes);
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
  struct {
    int prio[3];
    int headOrder[3];  // ids (1..3, in put order) as they leave the head
  } rows[] = {{{5, 3, 5}, {2, 3, 1}}, {{1, 9, 4}, {1, 3, 2}}};
  for (const auto& row : rows) {
    Queue q;
    Rec r1(1, row.prio[0]), r2(2, row.prio[1]), r3(3, row.prio[2]);
    for (Rec* r : {&r1, &r2, &r3}) q.putHeadWithPriorityAndNotify(&r->qe);
    int32_t w = 0;
    for (int id : row.headOrder) EXPECT_EQ(id, idOf(q.getHeadWithWait(&w)));
  }
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

TEST(MtQueue, TwoWaitingConsumersGetTwoElementsPutBeforeEitherRuns) {
  Queue q;
  // Posts are counted: two made before anyone waits let two waits through.
  ASSERT_EQ(0u, q.waitpost.post());
  ASSERT_EQ(0u, q.waitpost.post());
  EXPECT_EQ(0u, q.waitpost.wait(0));
  EXPECT_EQ(0u, q.waitpost.wait(0));
  EXPECT_EQ(ECF_TIMEOUT, q.waitpost.wait(0));

  OrdListElement* got[2] = {nullptr, nullptr};
  std::vector<std::thread> consumers;
  for (int c = 0; c < 2; ++c)
    consumers.emplace_back([&, c] {
      int32_t wait = 60000;
      got[c] = q.getHeadWithWait(&wait);
    });
  ASSERT_TRUE(thrtest::waitFor([&] { return waitersOf(q) == 2; }));
  Rec a(1, 0), b(2, 0);
  q.lk.lock();  // both puts (and posts) before either consumer takes
  q.putTailAndNotify(&a.qe.ole);
  q.putTailAndNotify(&b.qe.ole);
  q.lk.unlock("Queue");
  for (auto& t : consumers) t.join();
  EXPECT_EQ(3, idOf(got[0]) + idOf(got[1]));
  EXPECT_EQ(2, q.wakeups);
  EXPECT_EQ(0, q.timeouts);
}

TEST(MtQueue, AWakeupWhoseElementIsGoneKeepsTheConsumerWaiting) {
  Queue q;
  OrdListElement* got = nullptr;
  std::thread consumer([&] {
    int32_t wait = 60000;
    got = q.getHeadWithWait(&wait);
  });
  ASSERT_TRUE(thrtest::waitFor([&] { return waitersOf(q) == 1; }));
  Rec first(1, 0), second(2, 0);
  q.lk.lock();  // the consumer is posted, but another takes the element first
  q.putTailAndNotify(&first.qe.ole);
  int32_t none = 0;
  EXPECT_EQ(1, idOf(q.getHeadWithWait(&none)));
  q.lk.unlock("Queue");
  hsvSleep(50);  // not needed for the verdict: lets the consumer see the empty queue
  q.putTailAndNotify(&second.qe.ole);
  consumer.join();
  EXPECT_EQ(2, idOf(got));
  EXPECT_EQ(0, q.waiters);
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
  thrtest::mainReady();
  thrtest::LogCapture cap;
  // A hang is the fault: the child is given up after its time-out.
  auto c = thrtest::inChild(cap.dir(), [] {
    Queue q;
    g_stopQueue = &q;
    OrdList list("Threads");
    list.makeShared(nullptr, 1);
    int code = -1;
    klpThread* t = createThread(&code, &list, queueWaiter, "QWaiter", nullptr, 1, nullptr, 0, 0);
    if (!thrtest::waitFor([&] { return waitersOf(q) == 1; })) return 91;
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
  EXPECT_TRUE(c.exited) << c.out;
  EXPECT_EQ(0, c.exitCode) << c.out;
}

}  // namespace
