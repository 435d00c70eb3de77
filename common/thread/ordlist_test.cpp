#include "common/thread/ordlist.h"

#include <gtest/gtest.h>
#include <pthread.h>

#include <atomic>
#include <thread>
#include <vector>

#include "common/thread/klpthread.h"
#include "common/thread/thread_testutil.h"
#include "common/util/klprc.h"

namespace {

struct Item {
  OrdListElement ole;
  int value;
  explicit Item(int v) : value(v) {}
};

int valueOf(OrdListElement* e) { return e ? reinterpret_cast<Item*>(e)->value : -1; }

// Walks the list both ways and checks the links agree with the count.
void expectSound(OrdList& l) {
  int n = 0;
  OrdListElement* last = nullptr;
  for (OrdListElement* e = l.olHead; e; e = e->olePrev) {
    EXPECT_EQ(e->oleNext, last);
    EXPECT_EQ(e->oleAnchor, &l);
    last = e;
    ++n;
  }
  EXPECT_EQ(last, l.olTail);
  EXPECT_EQ(n, l.count);
}

TEST(OrdList, BothEndsTakeAndGiveInOrderWithCounts) {
  OrdList l;
  Item a(1), b(2), c(3);
  for (Item* i : {&a, &b, &c}) ASSERT_EQ(0, l.putTail(&i->ole));
  EXPECT_EQ(3, l.count);
  expectSound(l);
  EXPECT_EQ(1, valueOf(l.getHead()));
  EXPECT_EQ(2, l.count);
  EXPECT_EQ(3, valueOf(l.getTail()));
  OrdListElement* last = l.getHead();
  EXPECT_EQ(2, valueOf(last));
  expectSound(l);
  EXPECT_EQ(nullptr, l.olHead);
  EXPECT_EQ(nullptr, last->oleAnchor);
  EXPECT_EQ(nullptr, l.getHead());
  EXPECT_EQ(nullptr, l.getTail());
  // putHead reverses.
  for (Item* i : {&a, &b, &c}) ASSERT_EQ(0, l.putHead(&i->ole));
  expectSound(l);
  EXPECT_EQ(3, valueOf(l.getHead()));
  EXPECT_EQ(1, valueOf(l.getTail()));
  EXPECT_EQ(2, valueOf(l.getHead()));
}

TEST(OrdList, BrowsingSkipsWithdrawnElementsInBothDirections) {
  OrdList l;
  Item a(1), b(2), c(3), d(4);
  for (Item* i : {&a, &b, &c, &d}) l.putTail(&i->ole);
  a.ole.withdrawn = 1;
  c.ole.withdrawn = 1;
  EXPECT_EQ(2, valueOf(l.browseHead()));
  EXPECT_EQ(4, valueOf(OrdList::browsePrev(&b.ole)));
  EXPECT_EQ(nullptr, OrdList::browsePrev(&d.ole));
  EXPECT_EQ(4, valueOf(l.browseTail()));
  EXPECT_EQ(2, valueOf(OrdList::browseNext(&d.ole)));
  EXPECT_EQ(nullptr, OrdList::browseNext(&b.ole));
  d.ole.withdrawn = 1;
  b.ole.withdrawn = 1;
  EXPECT_EQ(nullptr, l.browseHead());
  EXPECT_EQ(4, l.count);  // browsing changes nothing
  Item free(9);
  EXPECT_EQ(nullptr, OrdList::browsePrev(&free.ole));
  EXPECT_EQ(nullptr, OrdList::browseNext(nullptr));
}

TEST(OrdList, DeChainFromEveryPositionKeepsTheChainSound) {
  OrdList l;
  Item a(1), b(2), c(3), d(4);
  for (Item* i : {&a, &b, &c, &d}) l.putTail(&i->ole);
  for (Item* i : {&b, &a, &d}) {  // middle, head, tail
    EXPECT_EQ(0, ordListDeChain(&i->ole));
    expectSound(l);
  }
  EXPECT_EQ(3, valueOf(l.olHead));
  EXPECT_EQ(0, ordListDeChain(&c.ole));  // the only one
  expectSound(l);
  EXPECT_EQ(nullptr, l.olHead);
  for (Item* i : {&a, &b, &c, &d})
    EXPECT_TRUE(!i->ole.oleAnchor && !i->ole.olePrev && !i->ole.oleNext) << i->value;
  EXPECT_EQ(0, ordListDeChain(&a.ole));  // on no list: nothing
  EXPECT_EQ(0, ordListDeChain(nullptr));
}

TEST(OrdList, DeChainOfABrokenChainReports8000AndStillUnlinks) {
  thrtest::LogCapture cap;
  OrdList l("BrokenList");
  Item a(1), b(2), c(3);
  for (Item* i : {&a, &b, &c}) l.putTail(&i->ole);
  b.ole.oleNext = nullptr;  // damage: the head-side neighbour is lost
  EXPECT_EQ(0, ordListDeChain(&b.ole));
  EXPECT_EQ(2, l.count);
  EXPECT_EQ(nullptr, b.ole.oleAnchor);
  // The tail side was still relinked, to what the damaged element knew.
  EXPECT_EQ(nullptr, c.ole.oleNext);
  EXPECT_EQ(nullptr, b.ole.olePrev);
  EXPECT_TRUE(cap.issuedWith(8000, {"KlpOLE:", "BrokenList"})) << cap.log();
}

TEST(OrdList, AnElementOnAListCannotBePutOnAnother) {
  OrdList one, two;
  Item a(1), b(2);
  one.putTail(&a.ole);
  one.putTail(&b.ole);
  EXPECT_EQ(KLP_RC_BAD_PARM, two.putTail(&a.ole));
  EXPECT_EQ(KLP_RC_BAD_PARM, two.putHead(&b.ole));
  EXPECT_EQ(0, two.count);
  EXPECT_EQ(2, one.count);
  expectSound(one);
}

TEST(OrdList, DelListFreesEveryElementAndDestructionLeavesThemFree) {
  {
    OrdList l;
    for (int i = 0; i < 5; ++i) l.putTail(&(new Item(i))->ole);
    l.delList();  // the sanitizer build reports a leak if one is left
    EXPECT_EQ(0, l.count);
    EXPECT_EQ(nullptr, l.olHead);
    EXPECT_EQ(nullptr, l.olTail);
    l.delList();  // empty: nothing
  }
  Item a(1), b(2);
  alignas(OrdList) unsigned char raw[sizeof(OrdList)];
  OrdList* l = new (raw) OrdList;
  l->makeShared(nullptr, 1);
  l->putTail(&a.ole);
  l->putTail(&b.ole);
  l->~OrdList();
  EXPECT_STREQ("DELList", l->qName);
  EXPECT_EQ(nullptr, l->self);
  EXPECT_EQ(nullptr, a.ole.oleAnchor);
  EXPECT_EQ(nullptr, b.ole.oleNext);
}

TEST(OrdList, PrintShowsNamesAndSixteenDigitAddresses) {
  thrtest::LogCapture cap;
  auto c = thrtest::inChild(cap.dir(), [] {
    OrdList l("PrintMe");
    Item a(1);
    l.putTail(&a.ole);
    l.print();
    OrdList::print(&a.ole);
    return 0;
  });
  ASSERT_TRUE(c.exited);
  for (const char* part : {"OrdList:print entered for list PrintMe\n", " qName=PrintMe\n",
                           "OrdList:print exit for list PrintMe\n",
                           " olTail=0000",  // 16 digits, zero-padded
                           " oleName=PrintMe\n", " olePrev=0000000000000000\n"})
    EXPECT_NE(std::string::npos, c.out.find(part)) << part << " in\n" << c.out;
}

TEST(OrdList, ADamagedElementOrListIsFatalWithDiagnosticsOnStandardOutput) {
  thrtest::LogCapture cap;
  for (bool damageList : {false, true}) {
    auto c = thrtest::inChild(cap.dir(), [damageList] {
      OrdList l("Shared");
      Item a(1);
      if (damageList) {  // a locked list whose self pointer is wrong
        l.makeShared(nullptr, 1);
        l.self = nullptr;
      } else {
        memset(a.ole.eyeCatcher, 0x01, sizeof a.ole.eyeCatcher);
      }
      l.putTail(&a.ole);
      return 0;  // not reached
    });
    EXPECT_FALSE(c.exited);
    EXPECT_EQ(SIGABRT, c.signal);
    EXPECT_NE(std::string::npos, c.out.find(damageList ? "OrdList" : "KLP fatal error in OrdList::putTail"))
        << c.out;
  }
}

// The lock, with real threads.
TEST(MtOrdList, TheOwnerReentersThreeDeepAndOthersWaitForTheLastRelease) {
  thrtest::mainReady();
  OrdList l("Reentry");
  l.makeShared(nullptr, 1);
  for (int i = 0; i < 3; ++i) ASSERT_EQ(0, l.lockList());
  EXPECT_EQ(3, l.depth());
  EXPECT_EQ(klpMainThread(), l.owner());
  Item a(1);
  EXPECT_EQ(0, l.putTail(&a.ole));  // nested operation by the owner
  EXPECT_EQ(3, l.depth());

  std::atomic<bool> entered{false};
  std::thread other([&] {
    Item* b = new Item(2);
    l.putTail(&b->ole);
    entered = true;
  });
  hsvSleep(100);
  EXPECT_FALSE(entered);
  for (int i = 0; i < 2; ++i) EXPECT_EQ(0, l.unlockList());
  hsvSleep(100);
  EXPECT_FALSE(entered) << "entered before the owner's last release";
  EXPECT_EQ(0, l.unlockList());
  other.join();
  EXPECT_TRUE(entered);
  EXPECT_EQ(0, l.depth());
  EXPECT_EQ(nullptr, l.owner());
  ordListDeChain(&a.ole);
  l.delList();
}

TEST(MtOrdList, AnotherThreadsUnlockIsRefusedWith624AndTheLockStaysHeld) {
  thrtest::mainReady();
  thrtest::LogCapture cap;
  OrdList l("Guarded");
  l.makeShared(nullptr, 1);
  ASSERT_EQ(0, l.lockList());
  int rc = -1;
  std::thread other([&] { rc = l.unlockList(); });
  other.join();
  EXPECT_EQ(KLP_RC_NOT_LOCK_OWNER, rc);
  EXPECT_EQ(1, l.depth());
  EXPECT_EQ(klpMainThread(), l.owner());
  // Still held by us: a third thread cannot get in until we release.
  std::atomic<bool> entered{false};
  std::thread third([&] {
    l.lockList();
    entered = true;
    l.unlockList();
  });
  hsvSleep(100);
  EXPECT_FALSE(entered);
  EXPECT_EQ(0, l.unlockList());
  third.join();
  EXPECT_TRUE(entered);
  char owner[32];
  snprintf(owner, sizeof owner, "Initial:0x%08x",
           static_cast<unsigned>(reinterpret_cast<uintptr_t>(klpMainThread()) & 0xFFFFFFFFu));
  // Caller (unregistered), list, last error, reason, owner, depth.
  EXPECT_TRUE(cap.issuedWith(
      624, {"UNKNOWN", "Guarded", "0", "Thread does not hold lock", owner, "1"}))
      << cap.log();
}

TEST(MtOrdList, ProducersAndConsumersKeepEveryElement) {
  OrdList l("Busy");
  l.makeShared(nullptr, 1);
  constexpr int kEach = 2000;
  std::atomic<int> taken{0};
  std::atomic<long> sum{0};
  std::vector<std::thread> ts;
  for (int p = 0; p < 2; ++p)
    ts.emplace_back([&, p] {
      for (int i = 0; i < kEach; ++i) {
        Item* it = new Item(p * kEach + i);
        if (i % 2) l.putTail(&it->ole); else l.putHead(&it->ole);
      }
    });
  for (int c = 0; c < 2; ++c)
    ts.emplace_back([&, c] {
      for (int spins = 0; taken < 2 * kEach && spins < 2000000; ++spins) {
        OrdListElement* e = c ? l.getHead() : l.getTail();
        if (!e) {
          sched_yield();
          continue;
        }
        sum += valueOf(e);
        delete reinterpret_cast<Item*>(e);
        ++taken;
      }
    });
  for (auto& t : ts) t.join();
  EXPECT_EQ(2 * kEach, taken.load());
  EXPECT_EQ(static_cast<long>(2 * kEach) * (2 * kEach - 1) / 2, sum.load());
  EXPECT_EQ(0, l.count);
}

}  // namespace
