// Message queues between real processes.
#include <gtest/gtest.h>

#include <pthread.h>
#include <signal.h>

#include <cstring>
#include <string>
#include <thread>
#include <vector>

#include "common/platform/hsv.h"
#include "common/platform/hsv_testutil.h"
#include "tests/testing/klptest.h"

using hsvtest::forkRun;
using hsvtest::waitChild;

namespace {

HSVResID queueID(const std::string& path) {
  HSVResID id{};
  EXPECT_EQ(hsvIPCGetQueResID(path.c_str(), HSV_QUEUE_RESID_OPTION, &id), ECF_OK);
  return id;
}

// Message i: a byte pattern of a length that varies up to the maximum.
std::string message(int i) {
  size_t len = (static_cast<size_t>(i) * 397) % (HSV_MAX_MSG_SIZE + 1);
  std::string m(len, '\0');
  for (size_t k = 0; k < len; ++k) m[k] = static_cast<char>((i * 31 + k) & 0xff);
  return m;
}

class QueueTest : public ::testing::Test {
 protected:
  void SetUp() override {
    path_ = tmp_.path() + "MYDB.KLP.KCAP.IPC";
    id_ = queueID(path_);
  }
  void TearDown() override {
    // Checked, and cleaned up even when a failed assertion skipped destroy().
    bool left = klptest::queueExists(path_);
    if (left) {
      HSVHIPCQueue q;
      if (q.attach(id_) == ECF_OK) q.destroy();
    }
    EXPECT_FALSE(left) << "queue left behind";
  }
  // Creates the test's queue, failing the test when that is impossible.
  void createQueue(HSVHIPCQueue& q) {
    ASSERT_EQ(q.create(id_, HSV_MAX_MSG_SIZE, HSV_CREATE_OPTION), ECF_OK);
  }
  klptest::TmpDir tmp_;
  std::string path_;
  HSVResID id_{};
};

TEST_F(QueueTest, MessagesCrossProcessesWholeAndInOrder) {
  HSVHIPCQueue q;
  createQueue(q);
  constexpr int kCount = 60;  // several times the queue depth: the sender must wait for room
  pid_t child = forkRun([&] {
    HSVHIPCQueue s;
    if (s.attach(queueID(path_)) != ECF_OK) return 1;
    for (int i = 0; i < kCount; ++i) {
      std::string m = message(i);
      if (s.put(m.data(), m.size()) != ECF_OK) return 2;
    }
    return 0;
  });
  std::vector<char> buf(HSV_MAX_MSG_SIZE);
  for (int i = 0; i < kCount; ++i) {
    size_t len = 12345;
    ASSERT_EQ(q.get(buf.data(), buf.size(), &len, 10000), ECF_OK) << "message " << i;
    std::string expected = message(i);
    ASSERT_EQ(len, expected.size()) << "message " << i;
    ASSERT_EQ(std::string(buf.data(), len), expected) << "message " << i;
  }
  EXPECT_EQ(waitChild(child), 0);
  EXPECT_FALSE(q.hasMessage());
  EXPECT_EQ(q.destroy(), ECF_OK);
}

TEST_F(QueueTest, AttachNeedsAnExistingQueue) {
  HSVHIPCQueue a;
  EXPECT_EQ(a.attach(id_), ECF_NOT_FOUND);
  EXPECT_FALSE(a.isOpen());

  HSVHIPCQueue q;
  createQueue(q);
  HSVHIPCQueue twice;
  EXPECT_EQ(twice.create(id_, HSV_MAX_MSG_SIZE, HSV_CREATE_OPTION), ECF_ALREADY_EXISTS);

  // Another process finds it by the path alone, with its message size.
  pid_t child = forkRun([&] {
    HSVHIPCQueue c;
    if (c.attach(queueID(path_)) != ECF_OK) return 1;
    return c.maxMsgSize() == HSV_MAX_MSG_SIZE ? 0 : 2;
  });
  EXPECT_EQ(waitChild(child), 0);

  // Detach keeps the queue; destroy removes it.
  ASSERT_EQ(a.attach(id_), ECF_OK);
  EXPECT_EQ(a.detach(), ECF_OK);
  EXPECT_TRUE(klptest::queueExists(path_));
  EXPECT_EQ(q.destroy(), ECF_OK);
  EXPECT_EQ(a.attach(id_), ECF_NOT_FOUND);
}

TEST_F(QueueTest, GetTimesOutWithTheTimeoutCode) {
  HSVHIPCQueue q;
  createQueue(q);
  char buf[HSV_MAX_MSG_SIZE];
  size_t len = 77;
  EXPECT_EQ(q.get(buf, sizeof buf, &len, 0), ECF_TIMEOUT);
  int64_t start = hsvtest::nowMs();
  hsvRC rc = q.get(buf, sizeof buf, &len, 150);
  EXPECT_EQ(rc, 0x90000013u);
  EXPECT_GE(hsvtest::nowMs() - start, 140);  // it did wait, not give up at once
  EXPECT_EQ(len, 0u);
  EXPECT_EQ(q.destroy(), ECF_OK);
}

TEST_F(QueueTest, LengthsFromCallersAreChecked) {
  HSVHIPCQueue q;
  createQueue(q);
  std::string big(HSV_MAX_MSG_SIZE + 1, 'x');
  EXPECT_EQ(q.put(big.data(), big.size()), ECF_MSG_TOO_BIG);
  EXPECT_FALSE(q.hasMessage());

  ASSERT_EQ(q.put("hello", 5), ECF_OK);
  char small[64];
  size_t len = 0;
  EXPECT_EQ(q.get(small, sizeof small, &len, 0), ECF_BUFFER_TOO_SMALL);
  EXPECT_EQ(q.get(nullptr, HSV_MAX_MSG_SIZE, &len, 0), ECF_INVALID_ARGUMENT);
  // The refused get did not consume the message.
  EXPECT_TRUE(q.hasMessage());
  std::vector<char> buf(HSV_MAX_MSG_SIZE);
  ASSERT_EQ(q.get(buf.data(), buf.size(), &len, 0), ECF_OK);
  EXPECT_EQ(std::string(buf.data(), len), "hello");

  EXPECT_EQ(q.create(id_, 0, HSV_CREATE_OPTION), ECF_INVALID_ARGUMENT);  // already open
  EXPECT_EQ(q.destroy(), ECF_OK);

  HSVHIPCQueue closed;
  EXPECT_EQ(closed.put("x", 1), ECF_NOT_ATTACHED);
  EXPECT_EQ(closed.get(buf.data(), buf.size(), &len, 0), ECF_NOT_ATTACHED);
  EXPECT_EQ(closed.waitForMessage(0), ECF_NOT_ATTACHED);
  EXPECT_EQ(closed.destroy(), ECF_NOT_ATTACHED);
  EXPECT_FALSE(closed.hasMessage());
  HSVHIPCQueue zero;
  EXPECT_EQ(zero.create(id_, 0, HSV_CREATE_OPTION), ECF_INVALID_ARGUMENT);

  // An id whose name text is not NUL-ended is refused, not read past.
  HSVResID bad = id_;
  memset(bad.part2, 'a', sizeof bad.part2);
  EXPECT_EQ(zero.attach(bad), ECF_INVALID_ARGUMENT);
}

TEST_F(QueueTest, PutToAFullQueueWaitsForRoom) {
  HSVHIPCQueue q;
  createQueue(q);
  for (int i = 0; i < HSV_QUEUE_DEPTH; ++i) ASSERT_EQ(q.put(&i, sizeof i), ECF_OK);
  int extra = 1000;
  EXPECT_EQ(q.putWait(&extra, sizeof extra, 0), ECF_QUEUE_FULL);
  EXPECT_EQ(q.putWait(&extra, sizeof extra, 100), ECF_QUEUE_FULL);

  // A reader in another process makes room a little later; put waits for it.
  pid_t child = forkRun([&] {
    HSVHIPCQueue r;
    if (r.attach(queueID(path_)) != ECF_OK) return 1;
    hsvSleep(200);
    char buf[HSV_MAX_MSG_SIZE];
    size_t len = 0;
    if (r.get(buf, sizeof buf, &len, 5000) != ECF_OK) return 2;
    int first = -1;
    memcpy(&first, buf, sizeof first);
    return len == sizeof(int) && first == 0 ? 0 : 3;
  });
  EXPECT_EQ(q.put(&extra, sizeof extra), ECF_OK);
  EXPECT_EQ(waitChild(child), 0);

  // What is left is 1..9 then the extra one.
  char buf[HSV_MAX_MSG_SIZE];
  size_t len = 0;
  for (int i = 1; i <= HSV_QUEUE_DEPTH; ++i) {
    int v = -1;
    ASSERT_EQ(q.get(buf, sizeof buf, &len, 0), ECF_OK);
    memcpy(&v, buf, sizeof v);
    EXPECT_EQ(v, i < HSV_QUEUE_DEPTH ? i : extra);
  }
  EXPECT_EQ(q.destroy(), ECF_OK);
}

TEST_F(QueueTest, WaitForMessageWakesWhenAnotherProcessPuts) {
  HSVHIPCQueue q;
  createQueue(q);
  EXPECT_FALSE(q.hasMessage());
  EXPECT_EQ(q.waitForMessage(0), ECF_TIMEOUT);
  EXPECT_EQ(q.waitForMessage(50), ECF_TIMEOUT);

  pid_t child = forkRun([&] {
    HSVHIPCQueue s;
    if (s.attach(queueID(path_)) != ECF_OK) return 1;
    hsvSleep(150);
    return s.put("wake", 4) == ECF_OK ? 0 : 2;
  });
  EXPECT_EQ(q.waitForMessage(10000), ECF_OK);
  // Waiting does not take the message.
  EXPECT_TRUE(q.hasMessage());
  EXPECT_EQ(q.waitForMessage(0), ECF_OK);
  char buf[HSV_MAX_MSG_SIZE];
  size_t len = 0;
  ASSERT_EQ(q.get(buf, sizeof buf, &len, 0), ECF_OK);
  EXPECT_EQ(std::string(buf, len), "wake");
  EXPECT_EQ(waitChild(child), 0);
  EXPECT_EQ(q.destroy(), ECF_OK);
}

void onSignal(int) {}

TEST_F(QueueTest, SignalsDoNotCutWaitsShort) {
  struct sigaction sa {}, old{};
  sa.sa_handler = onSignal;  // no SA_RESTART: the calls see EINTR
  sigemptyset(&sa.sa_mask);
  ASSERT_EQ(sigaction(SIGUSR1, &sa, &old), 0);

  HSVHIPCQueue q;
  createQueue(q);
  pthread_t waiter = pthread_self();
  std::thread poker([waiter] {
    for (int i = 0; i < 3; ++i) {
      hsvSleep(40);
      pthread_kill(waiter, SIGUSR1);
    }
  });
  char buf[HSV_MAX_MSG_SIZE];
  size_t len = 0;
  int64_t start = hsvtest::nowMs();
  EXPECT_EQ(q.get(buf, sizeof buf, &len, 300), ECF_TIMEOUT);
  EXPECT_GE(hsvtest::nowMs() - start, 290);
  poker.join();

  std::thread poker2([waiter] {
    for (int i = 0; i < 3; ++i) {
      hsvSleep(40);
      pthread_kill(waiter, SIGUSR1);
    }
  });
  start = hsvtest::nowMs();
  EXPECT_EQ(q.waitForMessage(300), ECF_TIMEOUT);
  EXPECT_GE(hsvtest::nowMs() - start, 290);
  poker2.join();

  EXPECT_EQ(q.destroy(), ECF_OK);
  sigaction(SIGUSR1, &old, nullptr);
}

}  // namespace
