// Queues and shared memory between processes: ownership, whole messages in
// order, waits, callers' mistakes, the same bytes and byte locks.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <mqueue.h>
#include <pthread.h>
#include <signal.h>
#include <sys/mman.h>
#include <unistd.h>

#include <chrono>
#include <cstring>
#include <functional>
#include <future>
#include <string>
#include <thread>
#include <vector>

#include "common/platform/hsv.h"
#include "tests/testing/klptest.h"

namespace {

// The test's queue and shared-memory block (not a page multiple: attach must
// report this size), created first and checked gone at the end.
struct IpcTest : ::testing::Test {
  static constexpr size_t kSize = 100000;
  klptest::TmpDir tmp;
  std::string path = tmp.path() + "MYDB.KLP.KCAP.IPC";
  HSVResID id, mid;
  HSVHIPCQueue q;
  HSVHIPCMemory m;
  std::vector<char> buf = std::vector<char>(HSV_MAX_MSG_SIZE);
  size_t len = 77;
  void SetUp() override {
    ASSERT_EQ(ECF_OK, hsvIPCGetQueResID(path.c_str(), HSV_QUEUE_RESID_OPTION, &id));
    ASSERT_EQ(ECF_OK, hsvIPCGetResID(path.c_str(), HSV_MEMORY_RESID_OPTION, &mid));
    ASSERT_EQ(ECF_OK, q.create(id, HSV_MAX_MSG_SIZE, 51) | m.create(mid, kSize, 51));
  }
  void TearDown() override {
    EXPECT_EQ(ECF_OK, q.destroy() | m.destroy());
    EXPECT_FALSE(klptest::queueExists(path) || klptest::memoryExists(path));
  }
  // Runs body in another process, attached to both, while the test goes on.
  std::future<klptest::Child> other(std::function<int(HSVHIPCQueue&, HSVHIPCMemory&)> body) {
    return std::async(std::launch::async, [this, body] {
      return klptest::inChild(tmp.path(), [&] {
        HSVHIPCQueue oq;
        HSVHIPCMemory om;
        return oq.attach(id) != ECF_OK || om.attach(mid) != ECF_OK ? 99 : body(oq, om);
      }, 120000);
    });
  }
  std::string got() const { return std::string(buf.data(), len); }
};

// Message i: a byte pattern of a length that varies up to the maximum.
std::string message(int i) {
  std::string m((static_cast<size_t>(i) * 397) % (HSV_MAX_MSG_SIZE + 1), '\0');
  for (size_t k = 0; k < m.size(); ++k) m[k] = static_cast<char>((i * 31 + k) & 0xff);
  return m;
}

// Several times the queue's depth: the sender waits for room.
TEST_F(IpcTest, MessagesCrossProcessesWholeAndInOrder) {
  auto sender = other([](HSVHIPCQueue& s, HSVHIPCMemory&) {
    if (s.maxMsgSize() != HSV_MAX_MSG_SIZE) return 1;
    for (int i = 0; i < 60; ++i)
      if (s.put(message(i).data(), message(i).size()) != ECF_OK) return 2;
    return 0;
  });
  for (int i = 0; i < 60; ++i) {
    ASSERT_EQ(ECF_OK, q.get(buf.data(), buf.size(), &len, 10000)) << i;
    ASSERT_EQ(message(i), got()) << i;
  }
  EXPECT_EQ(0, sender.get().exitCode);
  EXPECT_FALSE(q.hasMessage());
}

// A queue or block made first under our name by someone else: only a private
// one of ours is used. A second user is not at hand in a test, but the mode
// such a user would have to grant us is, and is refused the same way. Root
// opens a read-only object all the same, so that row is for other users.
TEST_F(IpcTest, OnlyPrivateObjectsOfOursAreUsed) {
  ASSERT_EQ(ECF_OK, q.destroy() | m.destroy());
  const struct { mode_t mode; hsvRC attach, create; } rows[] = {
      {0600, ECF_OK, ECF_ALREADY_EXISTS},   {0666, ECF_NOT_OWNED, ECF_NOT_OWNED},
      {0640, ECF_NOT_OWNED, ECF_NOT_OWNED}, {0602, ECF_NOT_OWNED, ECF_NOT_OWNED},
      {0610, ECF_NOT_OWNED, ECF_NOT_OWNED}, {0400, ECF_ACCESS_DENIED, ECF_ALREADY_EXISTS}};
  for (const auto& r : rows) {
    if (r.attach == ECF_ACCESS_DENIED && geteuid() == 0) continue;
    mq_attr attr{0, HSV_QUEUE_DEPTH, HSV_MAX_MSG_SIZE, 0, {}};
    mqd_t raw = mq_open(id.posixName(), O_RDWR | O_CREAT | O_EXCL, 0600, &attr);
    int fd = shm_open(mid.posixName(), O_RDWR | O_CREAT | O_EXCL, 0600);
    ASSERT_TRUE(raw >= 0 && fd >= 0 && ftruncate(fd, 4096) == 0);
    ASSERT_TRUE(fchmod(raw, r.mode) == 0 && fchmod(fd, r.mode) == 0);
    HSVHIPCQueue q1, q2;
    HSVHIPCMemory m1, m2;
    EXPECT_EQ(r.attach, q1.attach(id)) << std::oct << r.mode;
    EXPECT_EQ(r.attach == ECF_OK, q1.isOpen());
    EXPECT_EQ(r.create, q2.create(id, HSV_MAX_MSG_SIZE, HSV_CREATE_OPTION));
    EXPECT_EQ(r.attach, m1.attach(mid));
    EXPECT_EQ(r.attach == ECF_OK, m1.getAddress() != nullptr);
    EXPECT_EQ(r.create, m2.create(mid, 4096, HSV_CREATE_OPTION));
    mq_close(raw);
    close(fd);
    mq_unlink(id.posixName());
    shm_unlink(mid.posixName());
  }
  ASSERT_EQ(ECF_OK, q.create(id, HSV_MAX_MSG_SIZE, 51) | m.create(mid, kSize, 51));
}

// What callers pass is checked: lengths, buffers, ids, the object's state. A
// refused get leaves the message where it was.
TEST_F(IpcTest, CallersMistakesAreRefused) {
  HSVHIPCQueue closed;
  HSVHIPCMemory none;
  HSVResID unended = id;
  memset(unended.part2, 'a', sizeof unended.part2);
  std::string big(HSV_MAX_MSG_SIZE + 1, 'x');
  char small[64];
  const std::pair<hsvRC, hsvRC> rows[] = {  // made in order, as a braced list is
      {q.put(big.data(), big.size()), ECF_MSG_TOO_BIG},
      {q.get(buf.data(), buf.size(), &len, 0), ECF_TIMEOUT},
      {q.put("hello", 5), ECF_OK}, {q.put(nullptr, 1), ECF_INVALID_ARGUMENT},
      {q.get(small, sizeof small, &len, 0), ECF_BUFFER_TOO_SMALL},
      {q.get(nullptr, HSV_MAX_MSG_SIZE, &len, 0), ECF_INVALID_ARGUMENT},
      {closed.put("x", 1), ECF_NOT_ATTACHED}, {closed.waitForMessage(0), ECF_NOT_ATTACHED},
      {closed.get(buf.data(), buf.size(), &len, 0), ECF_NOT_ATTACHED},
      {closed.attach(unended), ECF_INVALID_ARGUMENT}, {none.attach(unended), ECF_INVALID_ARGUMENT},
      {closed.create(id, 0, 51), ECF_INVALID_ARGUMENT}, {none.create(mid, 0, 51), ECF_INVALID_ARGUMENT},
      {closed.destroy(), ECF_NOT_ATTACHED}, {none.detach(), ECF_NOT_ATTACHED},
      {none.destroy(), ECF_NOT_ATTACHED}, {m.create(mid, kSize, 51), ECF_INVALID_ARGUMENT},
      {q.create(id, HSV_MAX_MSG_SIZE, 51), ECF_INVALID_ARGUMENT}};  // the last two hold one already
  for (size_t i = 0; i < std::size(rows); ++i) EXPECT_EQ(rows[i].second, rows[i].first) << i;
  EXPECT_FALSE(closed.hasMessage());
  ASSERT_EQ(ECF_OK, q.get(buf.data(), buf.size(), &len, 0));
  EXPECT_EQ("hello", got());
}

TEST_F(IpcTest, PutToAFullQueueWaitsForRoom) {
  for (int i = 0; i < HSV_QUEUE_DEPTH; ++i) ASSERT_EQ(ECF_OK, q.put(&i, sizeof i));
  int extra = 1000;
  auto start = std::chrono::steady_clock::now();
  EXPECT_EQ(ECF_QUEUE_FULL, q.putWait(&extra, sizeof extra, 0));
  EXPECT_EQ(ECF_QUEUE_FULL, q.putWait(&extra, sizeof extra, 100));
  EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(95));
  // Another process makes room a little later: put waits for it.
  auto reader = other([](HSVHIPCQueue& r, HSVHIPCMemory&) {
    hsvSleep(200);
    std::vector<char> in(HSV_MAX_MSG_SIZE);
    size_t n = 0;
    return r.get(in.data(), in.size(), &n, 5000) == ECF_OK && n == sizeof(int) && !in[0] ? 0 : 1;
  });
  EXPECT_EQ(ECF_OK, q.put(&extra, sizeof extra));
  EXPECT_EQ(0, reader.get().exitCode);
  for (int want : {1, 2, 3, 4, 5, 6, 7, 8, 9, 1000}) {
    ASSERT_EQ(ECF_OK, q.get(buf.data(), buf.size(), &len, 0));
    EXPECT_EQ(std::string(reinterpret_cast<char*>(&want), sizeof want), got());
  }
}

TEST_F(IpcTest, WaitForMessageWakesWhenAnotherProcessPutsAndTakesNothing) {
  EXPECT_EQ(ECF_TIMEOUT, q.waitForMessage(0));
  EXPECT_EQ(ECF_TIMEOUT, q.waitForMessage(50));
  auto sender = other([](HSVHIPCQueue& s, HSVHIPCMemory&) {
    hsvSleep(150);
    return s.put("wake", 4) == ECF_OK ? 0 : 1;
  });
  EXPECT_EQ(ECF_OK, q.waitForMessage(10000));
  EXPECT_TRUE(q.hasMessage());
  EXPECT_EQ(ECF_OK, q.waitForMessage(0));
  ASSERT_EQ(ECF_OK, q.get(buf.data(), buf.size(), &len, 0));
  EXPECT_EQ("wake", got());
  EXPECT_EQ(0, sender.get().exitCode);
}

void ignoreSignal(int) {}

// A signal (no SA_RESTART) must not cut a timed wait short.
TEST_F(IpcTest, WaitsLastThroughSignals) {
  const std::pair<const char*, std::function<void()>> rows[] = {
      {"hsvSleep", [] { hsvSleep(250); }},
      {"get", [&] { EXPECT_EQ(ECF_TIMEOUT, q.get(buf.data(), buf.size(), &len, 250)); }},
      {"waitForMessage", [&] { EXPECT_EQ(ECF_TIMEOUT, q.waitForMessage(250)); }}};
  struct sigaction sa {}, old{};
  sa.sa_handler = ignoreSignal;
  ASSERT_EQ(0, sigaction(SIGUSR2, &sa, &old));
  for (const auto& [what, wait] : rows) {
    std::thread poker([self = pthread_self()] {
      for (int i = 0; i < 3; ++i) hsvSleep(40), pthread_kill(self, SIGUSR2);
    });
    auto start = std::chrono::steady_clock::now();
    wait();
    EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(245)) << what;
    poker.join();
  }
  sigaction(SIGUSR2, &old, nullptr);
}

TEST_F(IpcTest, ProcessesSeeTheSameBytes) {
  auto* p = static_cast<unsigned char*>(m.getAddress());
  EXPECT_EQ(kSize, m.getSize());
  EXPECT_EQ(std::string(kSize, '\0'), std::string(reinterpret_cast<char*>(p), kSize));
  memcpy(p, "from parent", 12);
  auto c = other([](HSVHIPCQueue&, HSVHIPCMemory& o) {
    char* q = static_cast<char*>(o.getAddress());
    if (o.getSize() != kSize || memcmp(q, "from parent", 12) != 0) return 1;
    memcpy(q + kSize - 11, "from child", 11);
    return o.detach() == ECF_OK ? 0 : 2;
  });
  EXPECT_EQ(0, c.get().exitCode);
  EXPECT_STREQ("from child", reinterpret_cast<char*>(p + kSize - 11));
}

TEST_F(IpcTest, ByteLockExcludesOtherProcesses) {
  struct Shared {
    uint8_t lock;
    uint64_t counter, overlap, inside;  // holders at once must never exceed 1
    uint32_t ready;                     // children at the start line
  };
  auto* s = static_cast<Shared*>(m.getAddress());
  auto work = [](HSVHIPCQueue&, HSVHIPCMemory& o) {
    auto* cs = static_cast<volatile Shared*>(o.getAddress());
    __atomic_fetch_add(&cs->ready, 1u, __ATOMIC_ACQ_REL);  // off once both are there
    for (int spins = 0; __atomic_load_n(&cs->ready, __ATOMIC_ACQUIRE) < 2; ++spins)
      if (spins > 10000) return 2;
      else hsvSleep(1);
    for (int i = 0; i < 20000; ++i) {
      hsvByteLock(&cs->lock);
      cs->inside = cs->inside + 1;
      if (cs->inside != 1) cs->overlap = cs->overlap + 1;
      // A plain read-modify-write with a pause: without exclusion counts get lost.
      uint64_t v = cs->counter;
      for (int spin = 0; spin < 20; ++spin) __asm__ __volatile__("");
      if (i % 512 == 0) sched_yield();
      cs->counter = v + 1;
      cs->inside = cs->inside - 1;
      hsvByteLockRelease(&cs->lock);
    }
    return 0;
  };
  auto a = other(work), b = other(work);
  EXPECT_TRUE(a.get().exitCode == 0 && b.get().exitCode == 0);
  EXPECT_EQ(2u * 20000, s->counter);
  EXPECT_EQ(0u, s->overlap);
  // Exchange answers the previous value; release stores 0.
  uint8_t first = hsvByteLockExchange(&s->lock), second = hsvByteLockExchange(&s->lock);
  EXPECT_TRUE(first == 0 && second == 1);
  hsvByteLockRelease(&s->lock);
  EXPECT_EQ(0, s->lock);
}

}  // namespace
