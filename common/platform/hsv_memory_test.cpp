// Shared memory and byte locks between real processes.
#include <gtest/gtest.h>

#include <cstring>
#include <string>

#include "common/platform/hsv.h"
#include "common/platform/hsv_testutil.h"
#include "tests/testing/klptest.h"

using hsvtest::forkRun;
using hsvtest::waitChild;

namespace {

HSVResID memoryID(const std::string& path) {
  HSVResID id{};
  EXPECT_EQ(hsvIPCGetResID(path.c_str(), HSV_MEMORY_RESID_OPTION, &id), ECF_OK);
  return id;
}

class MemoryTest : public ::testing::Test {
 protected:
  void SetUp() override {
    path_ = tmp_.path() + "MYDB.KLP.KCAP.TRC";
    id_ = memoryID(path_);
  }
  void TearDown() override {
    // Checked, and cleaned up even when a failed assertion skipped destroy().
    bool left = klptest::memoryExists(path_);
    if (left) {
      HSVHIPCMemory m;
      if (m.attach(id_) == ECF_OK) m.destroy();
    }
    EXPECT_FALSE(left) << "block left behind";
  }
  klptest::TmpDir tmp_;
  std::string path_;
  HSVResID id_{};
};

TEST_F(MemoryTest, ProcessesSeeTheSameBytes) {
  constexpr size_t kSize = 100000;  // not a page multiple: attach must report this size
  HSVHIPCMemory m;
  ASSERT_EQ(m.create(id_, kSize, HSV_CREATE_OPTION), ECF_OK);
  ASSERT_NE(m.getAddress(), nullptr);
  EXPECT_EQ(m.getSize(), kSize);
  unsigned char* p = static_cast<unsigned char*>(m.getAddress());
  for (size_t i = 0; i < kSize; ++i) ASSERT_EQ(p[i], 0) << "not zero-filled at " << i;
  memcpy(p, "from parent", 12);

  pid_t child = forkRun([&] {
    HSVHIPCMemory c;
    if (c.attach(memoryID(path_)) != ECF_OK) return 1;
    if (c.getSize() != kSize) return 2;
    char* q = static_cast<char*>(c.getAddress());
    if (memcmp(q, "from parent", 12) != 0) return 3;
    memcpy(q + kSize - 11, "from child", 11);
    return c.detach() == ECF_OK ? 0 : 4;
  });
  EXPECT_EQ(waitChild(child), 0);
  EXPECT_STREQ(reinterpret_cast<char*>(p + kSize - 11), "from child");

  HSVHIPCMemory other;
  EXPECT_EQ(other.create(id_, kSize, HSV_CREATE_OPTION), ECF_ALREADY_EXISTS);
  EXPECT_EQ(m.destroy(), ECF_OK);
  EXPECT_EQ(m.getAddress(), nullptr);
  EXPECT_EQ(other.attach(id_), ECF_NOT_FOUND);
}

TEST_F(MemoryTest, MisuseIsRefused) {
  HSVHIPCMemory m;
  EXPECT_EQ(m.attach(id_), ECF_NOT_FOUND);
  EXPECT_EQ(m.create(id_, 0, HSV_CREATE_OPTION), ECF_INVALID_ARGUMENT);
  EXPECT_EQ(m.detach(), ECF_NOT_ATTACHED);
  EXPECT_EQ(m.destroy(), ECF_NOT_ATTACHED);
  ASSERT_EQ(m.create(id_, 4096, HSV_CREATE_OPTION), ECF_OK);
  EXPECT_EQ(m.create(id_, 4096, HSV_CREATE_OPTION), ECF_INVALID_ARGUMENT);  // holds one already
  EXPECT_EQ(m.destroy(), ECF_OK);
}

TEST_F(MemoryTest, ByteLockExcludesOtherProcesses) {
  struct Shared {
    uint8_t lock;
    uint64_t counter;
    uint64_t inside;  // holders at once; must never exceed 1
    uint64_t overlap;
    uint32_t ready;  // children at the start line
    uint32_t go;     // set once both are there, so that they really contend
  };
  HSVHIPCMemory m;
  ASSERT_EQ(m.create(id_, sizeof(Shared), HSV_CREATE_OPTION), ECF_OK);
  auto* s = static_cast<Shared*>(m.getAddress());
  constexpr int kIterations = 20000;
  auto work = [&] {
    HSVHIPCMemory c;
    if (c.attach(memoryID(path_)) != ECF_OK) return 1;
    auto* cs = static_cast<volatile Shared*>(c.getAddress());
    __atomic_fetch_add(&cs->ready, 1u, __ATOMIC_ACQ_REL);
    int64_t giveUp = hsvtest::nowMs() + 10000;
    while (!__atomic_load_n(&cs->go, __ATOMIC_ACQUIRE))
      if (hsvtest::nowMs() > giveUp) return 2;
    for (int i = 0; i < kIterations; ++i) {
      hsvByteLock(&cs->lock);
      uint64_t in = cs->inside + 1;
      cs->inside = in;
      if (in != 1) cs->overlap = cs->overlap + 1;
      // A plain read-modify-write with a pause inside: without exclusion
      // increments get lost.
      uint64_t v = cs->counter;
      for (int spin = 0; spin < 20; ++spin) __asm__ __volatile__("");
      if (i % 512 == 0) sched_yield();
      cs->counter = v + 1;
      cs->inside = cs->inside - 1;
      hsvByteLockRelease(&cs->lock);
    }
    return 0;
  };
  pid_t a = forkRun(work);
  pid_t b = forkRun(work);
  int64_t giveUp = hsvtest::nowMs() + 10000;
  while (__atomic_load_n(&s->ready, __ATOMIC_ACQUIRE) < 2 && hsvtest::nowMs() < giveUp) hsvSleep(1);
  __atomic_store_n(&s->go, 1u, __ATOMIC_RELEASE);
  EXPECT_EQ(waitChild(a, 120000), 0);
  EXPECT_EQ(waitChild(b, 120000), 0);
  EXPECT_EQ(s->counter, 2u * kIterations);
  EXPECT_EQ(s->overlap, 0u);
  EXPECT_EQ(s->lock, 0);

  // Exchange answers the previous value; release stores 0.
  EXPECT_EQ(hsvByteLockExchange(&s->lock), 0);
  EXPECT_EQ(hsvByteLockExchange(&s->lock), 1);
  hsvByteLockRelease(&s->lock);
  EXPECT_EQ(s->lock, 0);
  EXPECT_EQ(m.destroy(), ECF_OK);
}

}  // namespace
