// Ordered lists and the wait/post queue over them.
#include <gtest/gtest.h>

#include <atomic>
#include <thread>

#include "common/platform/hsv.h"
#include "common/thread/klpthread.h"
#include "common/thread/ordlist.h"
#include "common/thread/queue.h"
#include "common/util/klprc.h"
#include "tests/testing/klptest.h"

namespace {

// Checks that the links agree both ways and with the count.
void expectSound(OrdList& l) {
  int n = 0;
  OrdListElement* last = nullptr;
  for (OrdListElement* e = l.olHead; e; last = e, e = e->olePrev, ++n)
    EXPECT_TRUE(e->oleNext == last && e->oleAnchor == &l);
  EXPECT_TRUE(last == l.olTail && n == l.count);
}

// What each take and browse of a script over elements 0..9 gave ("-": none), the list checked
// at every step. Tn putTail, Hn putHead, h getHead, t getTail, Dn ordListDeChain, Wn withdraw,
// b browseHead, B browseTail, Pn browsePrev, Nn browseNext, Xn put on another list (refused).
std::string play(const char* script, bool locked) {
  OrdListElement items[10];  // outlive the list, which unlinks them
  OrdList l("Script");
  if (locked) l.makeShared(nullptr, 1);
  std::string out;
  for (const char* p = script; *p != '\0'; ++p) {
    char op = *p;
    OrdListElement* e = isdigit(p[1]) ? &items[*++p - '0'] : nullptr;
    OrdListElement* got = nullptr;
    switch (op) {
      case 'T': EXPECT_EQ(0, l.putTail(e)); break;
      case 'H': EXPECT_EQ(0, l.putHead(e)); break;
      case 'D': EXPECT_EQ(0, ordListDeChain(got = e)); break;
      case 'W': e->withdrawn = 1; break;
      case 'X': EXPECT_TRUE(OrdList().putTail(e) == 2002 && OrdList().putHead(e) == 2002); break;
      case 'h': got = l.getHead(); break;
      case 't': got = l.getTail(); break;
      case 'b': got = l.browseHead(); break;
      case 'B': got = l.browseTail(); break;
      case 'P': got = OrdList::browsePrev(e); break;
      case 'N': got = OrdList::browseNext(e); break;
    }
    if (strchr("htbBPN", op)) out += (got ? std::to_string(got - items) : "-") + " ";
    EXPECT_TRUE(!got || !strchr("htD", op) || (!got->oleAnchor && !got->olePrev && !got->oleNext));
    expectSound(l);
    EXPECT_EQ(0, l.depth()) << script;  // every operation gives the lock back
  }
  return out;
}

TEST(OrdList, PutsTakesBrowsesDeChainsAndDeletesKeepOrderAndLinks) {
  struct { const char* script; const char* gives; } rows[] = {
      {"T1 T2 T3 h h h h t", "1 2 3 - - "},  // first in, first out; empty: null
      {"H1 H2 H3 h t h", "3 1 2 "},          // putHead reverses
      {"T1 T2 T3 X2 t t t", "3 2 1 "},
      {"T1 T2 T3 T4 W1 W3 b P2 P4 B N4 N2", "2 4 - 4 2 - "},  // withdrawn ones passed over
      {"T1 W1 b B", "- - "},
      {"T1 T2 T3 T4 D2 b D1 b D4 B D3 h", "1 3 3 - "},  // middle, head, tail, the only one
      {"T1 D1 D1 P1 N1 P N h", "- - - - - "},            // on no list: nothing
  };
  for (bool locked : {false, true})
    for (const auto& row : rows) EXPECT_EQ(row.gives, play(row.script, locked)) << row.script;
  OrdList two;  // delList frees every element; a destroyed list leaves its elements free
  for (int i = 0; i < 5; ++i) two.putTail(new OrdListElement);
  two.delList();  // the sanitizer build reports a leak if one is left
  EXPECT_TRUE(two.count == 0 && !two.olHead && !two.olTail);
  OrdListElement a, b;
  alignas(OrdList) unsigned char raw[sizeof(OrdList)];
  OrdList* l = new (raw) OrdList;
  l->makeShared(nullptr, 1);
  l->putTail(&a), l->putTail(&b);
  l->~OrdList();
  EXPECT_TRUE(!strcmp("DELList", l->qName) && !l->self && !a.oleAnchor && !a.olePrev && !b.oleNext);
}

// The print routines of lists and threads; a damaged element or list.
TEST(OrdList, PrintsAndADamagedElementOrListIsFatalWithDiagnosticsOnStandardOutput) {
  klptest::TmpDir tmp;
  // Damage: 0 none (prints); 1, 3 the eye-catcher (put at the tail, the head); 2 the self pointer.
  struct { int damage, signal; std::vector<const char*> shows; } rows[] = {
      {0, 0, {"OrdList:print entered for list PrintMe\n list Addr=0000", " qName=PrintMe\n olTail=0000",
              "OrdList:print exit for list PrintMe\nOrdList:print entered for list entry \n",
              " list Entry Addr=0000", " olePrev=0000000000000000\n oleNext=0000000000000000\n oleAnchor=",
              " oleName=PrintMe\nklpThread::print  Thread with name BehinderWorker and state 1 and RC 7 and"
              " RESTART TRUE and handle  0000000000000000\nklpThread::print  Thread with name BehinderWorker"
              " and state 1 and RC 7 and RESTART FALSE and handle  0000000000000000\n"}},
      {1, SIGABRT, {"KLP fatal error in OrdList::putTail: list element at 0x", " expected \"a readable"}},
      {2, SIGABRT, {"KLP fatal error in OrdList::putTail: OrdList at 0x", " expected \"self pointer\""}},
      {3, SIGABRT, {"KLP fatal error in OrdList::putHead: list element at 0x"}},
  };
  for (const auto& row : rows) {
    auto c = klptest::inChild(tmp.path(), [&] {
      OrdList l("PrintMe");
      OrdListElement a;
      if (row.damage % 2) memset(a.eyeCatcher, 0x01, sizeof a.eyeCatcher);
      if (row.damage == 2) l.makeShared(nullptr, 1), l.self = nullptr;
      row.damage == 3 ? l.putHead(&a) : l.putTail(&a);
      l.print(), OrdList::print(&a);
      klpThread t;
      t.setName("BehinderWorkerThread"), t.endCode = 7;  // the name cut to 14
      for (int restart : {1, 0}) t.restart = restart, klpThread::print(&t);
      return 0;
    });
    EXPECT_EQ(row.signal, c.signal);
    for (const char* part : row.shows) EXPECT_NE(std::string::npos, c.out.find(part)) << part << c.out;
  }
}

TEST(MtOrdList, TheOwnerReentersAndOnlyItsLastReleaseLetsOthersIn) {
  klptest::mainThreadReady();
  OrdList l("Reentry");
  l.makeShared(nullptr, 1);
  for (int i = 0; i < 3; ++i) ASSERT_EQ(0, l.lockList());
  OrdListElement a;
  EXPECT_EQ(0, l.putTail(&a));  // nested operation by the owner
  EXPECT_TRUE(l.depth() == 3 && l.owner() == klpMainThread());
  std::atomic<bool> entered{false};
  std::thread other([&] { entered = ordListDeChain(&a) == 0; });
  for (int i = 0; i < 3; ++i) {
    hsvSleep(30);  // not needed for the verdict: gives the other a chance to come in early
    EXPECT_FALSE(entered) << "entered before the owner's last release";
    EXPECT_EQ(0, l.unlockList());
  }
  other.join();
  EXPECT_TRUE(l.depth() == 0 && l.owner() == nullptr && l.count == 0);
}

struct Rec { QueueElement qe; int id; };
int idOf(OrdListElement* e) { return e ? reinterpret_cast<Rec*>(e)->id : 0; }

TEST(Queue, TakesFollowTheEndsAndThePrioritiesAndAWaitTimesOutOnlyWhenEmpty) {
  // Elements 1-3 put (T tail, H head, or a priority digit), taken from the head h or tail t (0: none).
  struct { const char* puts, *ends, *order; } rows[] = {
      {"TTH", "thtt", "2310"},  // 3 1 2 from the head
      {"HHH", "hhh", "321"},
      {"535", "hhh", "231"},  // ascending from the head, the last of equal ones first
      {"194", "hhh", "132"},
      {"355", "ttt", "231"},
  };
  for (const auto& row : rows) {
    Queue q;
    Rec r[3] = {{{{}, row.puts[0] - '0'}, 1}, {{{}, row.puts[1] - '0'}, 2}, {{{}, row.puts[2] - '0'}, 3}};
    for (int i = 0; i < 3; ++i)
      row.puts[i] == 'T'   ? q.putTailAndNotify(&r[i].qe.ole)
      : row.puts[i] == 'H' ? q.putHeadAndNotify(&r[i].qe.ole)
                           : q.putHeadWithPriorityAndNotify(&r[i].qe);
    std::string got;
    for (int32_t wait = 0; row.ends[got.size()]; wait = 0) {
      bool head = row.ends[got.size()] == 'h';
      got += std::to_string(idOf(head ? q.getHeadWithWait(&wait) : q.getTailWithWait(&wait)));
    }
    EXPECT_EQ(row.order, got) << row.puts;
    EXPECT_TRUE(q.count == 0 && !q.head && !q.tail && !r[0].qe.ole.olePrev && !r[0].qe.ole.oleNext);
    EXPECT_TRUE(q.idlePosts == 3 && q.waitpost.wait(0) == ECF_TIMEOUT);  // nobody waited: no post
  }
  Queue q;  // a wait takes at once when it need not wait; on an empty queue it times out
  Rec a{{}, 1};
  for (int32_t wait : {0, -5}) EXPECT_TRUE(q.getHeadWithWait(&wait) == nullptr && wait == 0);
  q.putTailAndNotify(&a.qe.ole);
  int32_t wait = 5000;
  EXPECT_TRUE(idOf(q.getTailWithWait(&wait)) == 1 && wait == 0 && q.immediateTakes == 1);
  wait = 100;
  EXPECT_TRUE(!q.getHeadWithWait(&wait) && q.timeouts == 1 && q.wakeups == 0 && q.waiters == 0 && wait > 0 &&
              wait == q.timeoutTime);
}

TEST(Queue, StatisticsPrintWholeNumberAveragesAndAFailingWaitPostIsNamed) {
  klptest::TmpDir tmp;
  auto c = klptest::inChild(tmp.path(), [] {
    Queue q;
    q.printStats();  // nothing yet: averages stay 0
    q.wakeupTime = 7, q.wakeups = 2, q.timeoutTime = 2500, q.timeouts = 1;
    q.printStats();
    q.wakeups = 0;  // the previous average stays
    q.printStats();
    // The object gone: a wait fails (no statistic changes), so does a post for a waiter.
    q.waitpost.destroy();
    int32_t wait = 100;
    if (q.getHeadWithWait(&wait) != nullptr || q.timeouts != 1 || q.waiters != 0) return 1;
    q.waiters = 1;
    Rec a{{}, 1};
    q.putTailAndNotify(&a.qe.ole);
    return --q.waiters;
  });
  EXPECT_EQ(0, c.exitCode);
  EXPECT_EQ("<=== wakeup stats: 0 / 0 = 0.00000, timeout stats:     0 / 0 = 0.00000 ===>\n"
            "<=== wakeup stats: 7 / 2 = 3.00000, timeout stats:     2500 / 1 = 2500.00000 ===>\n"
            "<=== wakeup stats: 7 / 0 = 3.00000, timeout stats:     2500 / 1 = 2500.00000 ===>\n"
            "Error from HSVHIPCWaitpost::wait -1879047169: ECF_WAITPOST_NOT_INITIALIZED\n"
            "Post WAITPOST_NOT_INITIALIZED\n", c.out);
}

TEST(MtQueue, WaitingConsumersAreWokenOncePerPutAndNoWakeUpIsLost) {
  // Consumers waiting; whether another takes the first element before the woken one comes.
  using Row = std::pair<int, bool>;
  for (auto [consumers, stolen] : {Row{1, false}, Row{2, false}, Row{1, true}}) {
    Queue q;
    std::vector<int> got(consumers);
    std::vector<std::thread> ts;
    for (int c = 0; c < consumers; ++c)
      ts.emplace_back([&, c, wait = int32_t{60000}]() mutable { got[c] = idOf(q.getHeadWithWait(&wait)); });
    ASSERT_TRUE(klptest::waitFor([&] {
      q.lk.lock();
      bool all = q.waiters == consumers;
      return q.lk.unlock("Queue"), all;
    }));
    Rec a{{}, 1}, b{{}, 2};
    q.lk.lock();  // the puts (and posts) before any consumer takes
    q.putTailAndNotify(&a.qe.ole);
    int32_t none = 0;
    if (stolen) {
      EXPECT_EQ(1, idOf(q.getHeadWithWait(&none)));
      q.lk.unlock("Queue");
      hsvSleep(50);  // not needed for the verdict: lets the consumer find the queue empty
      q.lk.lock();
    }
    if (consumers == 2 || stolen) q.putTailAndNotify(&b.qe.ole);
    q.lk.unlock("Queue");
    for (auto& t : ts) t.join();
    EXPECT_EQ(stolen ? 2 : consumers == 2 ? 3 : 1, consumers == 2 ? got[0] + got[1] : got[0]);
    EXPECT_TRUE(q.wakeups == consumers && q.timeouts + q.idlePosts + q.waiters == 0 && q.wakeupTime < 60000);
  }
}

}  // namespace
