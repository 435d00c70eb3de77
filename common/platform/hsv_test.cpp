// Resource ids and ownership, wait/post, clocks, libraries and the trap file.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <mqueue.h>
#include <sys/mman.h>
#include <sys/syscall.h>

#include <atomic>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <string>
#include <thread>

#include "common/platform/hsv.h"
#include "tests/testing/klptest.h"

namespace {

std::string printable(const HSVResID& id, size_t room = 128) {
  char buf[128];
  memset(buf, '#', sizeof buf);
  hsvResIDPrintable(id, buf, room);
  return std::string(buf, strnlen(buf, sizeof buf));
}

// Published 64-bit FNV-1a values: "a" af63dc4c8601ec8c, "foobar"
// 85944171f73967e8. No normalisation: another spelling is another object.
TEST(ResID, NamesAreTheFnv1aHashOfThePath) {
  HSVResID q{}, m{}, raw;
  ASSERT_EQ(ECF_OK, hsvIPCGetQueResID("a", HSV_QUEUE_RESID_OPTION, &q));
  EXPECT_STREQ("/klpq.af63dc4c8601ec8c", q.posixName());
  EXPECT_EQ("(mqueue, /klpq.af63dc4c8601ec8c, 48)", printable(q));
  ASSERT_EQ(ECF_OK, hsvIPCGetResID("foobar", HSV_MEMORY_RESID_OPTION, &m));
  EXPECT_EQ("(shm, /klpm.85944171f73967e8, 109)", printable(m));
  ASSERT_EQ(ECF_OK, hsvIPCGetQueResID("/tmp//a", 48, &m));
  ASSERT_EQ(ECF_OK, hsvIPCGetQueResID("/tmp/a", 48, &q));
  EXPECT_STRNE(q.posixName(), m.posixName());
  EXPECT_EQ(ECF_INVALID_ARGUMENT, hsvIPCGetQueResID(nullptr, 48, &q));
  EXPECT_EQ(ECF_INVALID_ARGUMENT, hsvIPCGetQueResID("", 48, &q));
  EXPECT_EQ(ECF_INVALID_ARGUMENT, hsvIPCGetResID("p", 109, nullptr));
  // Never written past the room given, nor read past a part without its NUL.
  EXPECT_EQ("(mqueue, ", printable(q, 10));
  EXPECT_EQ(std::string(128, '#'), printable(q, 0));
  memset(&raw, 'z', sizeof raw);
  std::string z = std::string(16, 'z') + ", " + std::string(40, 'z') + ", " + std::string(24, 'z');
  EXPECT_EQ("(" + z + ")", printable(raw));
  EXPECT_STREQ("time-out", ecfErrorGetDescription(0x90000013));
  EXPECT_STREQ("unknown platform error", ecfErrorGetDescription(0x12345678));
}

// A queue or block made first under our name by someone else: only a private
// one of ours is used. A second user is not at hand in a test, but the mode
// such a user would have to grant us is, and is refused the same way.
TEST(Ownership, OnlyPrivateObjectsOfOursAreUsed) {
  klptest::TmpDir tmp;
  std::string path = tmp.path() + "MYDB.KLP.KCAP.IPC";
  HSVResID qid{}, mid{};
  ASSERT_EQ(ECF_OK, hsvIPCGetQueResID(path.c_str(), HSV_QUEUE_RESID_OPTION, &qid));
  ASSERT_EQ(ECF_OK, hsvIPCGetResID(path.c_str(), HSV_MEMORY_RESID_OPTION, &mid));
  const struct { mode_t mode; hsvRC attach, create; } rows[] = {
      {0600, ECF_OK, ECF_ALREADY_EXISTS},   {0666, ECF_NOT_OWNED, ECF_NOT_OWNED},
      {0640, ECF_NOT_OWNED, ECF_NOT_OWNED}, {0602, ECF_NOT_OWNED, ECF_NOT_OWNED},
      {0610, ECF_NOT_OWNED, ECF_NOT_OWNED}, {0400, ECF_ACCESS_DENIED, ECF_ALREADY_EXISTS}};
  for (const auto& r : rows) {
    mq_attr attr{0, HSV_QUEUE_DEPTH, HSV_MAX_MSG_SIZE, 0, {}};
    mqd_t raw = mq_open(qid.posixName(), O_RDWR | O_CREAT | O_EXCL, 0600, &attr);
    int fd = shm_open(mid.posixName(), O_RDWR | O_CREAT | O_EXCL, 0600);
    ASSERT_TRUE(raw >= 0 && fd >= 0 && ftruncate(fd, 4096) == 0);
    ASSERT_TRUE(fchmod(raw, r.mode) == 0 && fchmod(fd, r.mode) == 0);
    HSVHIPCQueue q, q2;
    HSVHIPCMemory m, m2;
    EXPECT_EQ(r.attach, q.attach(qid)) << std::oct << r.mode;
    EXPECT_EQ(r.attach == ECF_OK, q.isOpen());
    EXPECT_EQ(r.create, q2.create(qid, HSV_MAX_MSG_SIZE, HSV_CREATE_OPTION));
    EXPECT_EQ(r.attach, m.attach(mid));
    EXPECT_EQ(r.attach == ECF_OK, m.getAddress() != nullptr);
    EXPECT_EQ(r.create, m2.create(mid, 4096, HSV_CREATE_OPTION));
    mq_close(raw);
    close(fd);
    mq_unlink(qid.posixName());
    shm_unlink(mid.posixName());
  }
}

TEST(Waitpost, PostsAreCountedAndKeptForTheWait) {
  HSVHIPCWaitpost wp;
  EXPECT_EQ(ECF_WAITPOST_NOT_INITIALIZED, wp.wait(0));
  EXPECT_EQ(ECF_WAITPOST_NOT_INITIALIZED, wp.post());
  ASSERT_EQ(ECF_OK, wp.create(HSV_CREATE_OPTION));
  EXPECT_EQ(ECF_ALREADY_EXISTS, wp.create(HSV_CREATE_OPTION));
  auto start = std::chrono::steady_clock::now();
  EXPECT_EQ(0x90000013u, wp.wait(100));
  EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(95));
  // Posts before the waits are each kept for one wait.
  EXPECT_EQ(ECF_OK, wp.post());
  EXPECT_EQ(ECF_OK, wp.post());
  EXPECT_EQ(ECF_OK, wp.wait(0));
  EXPECT_EQ(ECF_OK, wp.wait(5000));
  EXPECT_EQ(ECF_TIMEOUT, wp.wait(0));
  std::thread poster([&] { hsvSleep(100), wp.post(); });
  EXPECT_EQ(ECF_OK, wp.wait(10000));
  poster.join();
  // Destroy wakes a waiter with the closed code and does not wait for a post.
  std::atomic<hsvRC> result{ECF_OK};
  std::thread waiter([&] { result = wp.wait(-1); });
  hsvSleep(50);
  EXPECT_EQ(ECF_OK, wp.destroy());
  waiter.join();
  EXPECT_EQ(ECF_WAITPOST_NOT_INITIALIZED, result.load());
  EXPECT_EQ(ECF_WAITPOST_NOT_INITIALIZED, wp.wait(0));
  EXPECT_EQ(ECF_WAITPOST_NOT_INITIALIZED, wp.destroy());
}

// Waits and posts racing with destroy and create find the object closed or
// open, never freed state.
TEST(Waitpost, CallsRacingWithDestroyFindItClosedOrOpen) {
  HSVHIPCWaitpost wp;
  ASSERT_EQ(ECF_OK, wp.create(HSV_CREATE_OPTION));
  std::atomic<bool> done{false};
  std::atomic<int> odd{0};
  std::thread user([&] {
    while (!done) {
      hsvRC w = wp.wait(0), p = wp.post();
      odd += (w != ECF_OK && w != ECF_TIMEOUT && w != ECF_WAITPOST_NOT_INITIALIZED) +
             (p != ECF_OK && p != ECF_WAITPOST_NOT_INITIALIZED);
    }
  });
  for (int i = 0; i < 20000; ++i) wp.destroy(), wp.create(HSV_CREATE_OPTION);
  done = true;
  user.join();
  EXPECT_EQ(0, odd.load());
}

TEST(Clock, TimeAndIds) {
  HSVTimeUTC t = hsvTimeGetUTC();
  EXPECT_LE(std::llabs(t.seconds - static_cast<int64_t>(time(nullptr))), 2);
  EXPECT_TRUE(t.microseconds >= 0 && t.microseconds < 1000000);
  struct tm g {}, l{};
  char day[16];
  ASSERT_TRUE(hsvTimeGmTime(951782400, &g) && hsvTimeLocalTime(t.seconds, &l));
  EXPECT_STREQ("2000-02-29", (strftime(day, sizeof day, "%Y-%m-%d", &g), day));
  EXPECT_FALSE(hsvTimeGmTime(0, nullptr) || hsvTimeLocalTime(0, nullptr));
  uint64_t other = 0;
  std::thread([&] { other = hsvThreadID(); }).join();
  EXPECT_EQ(static_cast<uint64_t>(syscall(SYS_gettid)), hsvThreadID());
  EXPECT_NE(other, hsvThreadID());
  EXPECT_EQ(getpid(), hsvProcessID());
  EXPECT_EQ(ECF_OK, hsvOneTimeOnly() | hsvOneTimeOnly());
}

TEST(SharedLib, LoadsLibrariesAndResolvesSymbols) {
  HSVSharedLib c, m, missing;
  ASSERT_EQ(ECF_OK, c.load("libc.so.6", 4)) << c.lastError();
  EXPECT_EQ(7u, reinterpret_cast<size_t (*)(const char*)>(c.getFuncAddress("strlen"))("seven!!"));
  EXPECT_EQ(nullptr, c.getFuncAddress("klp_no_such_symbol"));
  EXPECT_NE('\0', c.lastError()[0]);
  EXPECT_EQ(ECF_ALREADY_EXISTS, c.load("libm.so.6", 0));  // would lose the first handle
  EXPECT_EQ(ECF_OK, c.unload());
  EXPECT_EQ(ECF_NOT_ATTACHED, c.unload());
  ASSERT_EQ(ECF_OK, m.load("libm.so.6", 0)) << m.lastError();
  EXPECT_EQ(1.0, reinterpret_cast<double (*)(double)>(m.getFuncAddress("cos"))(0.0));
  EXPECT_EQ(ECF_NOT_FOUND, missing.load("libklp_no_such_library.so.9", 4));
  EXPECT_NE(nullptr, strstr(missing.lastError(), "libklp_no_such_library"));
  EXPECT_FALSE(missing.isLoaded() || missing.getFuncAddress("cos"));
  EXPECT_EQ(ECF_INVALID_ARGUMENT, missing.load(nullptr, 0));
}

HSVTrapFile* gTrap = nullptr;

void dumpAndExit(int sig, siginfo_t* info, void* uc) {
  gTrap->dump(HSV_TRAPFILE_DUMP_OPTION, sig, info, uc);
  gTrap->write("***E**O**D**M***", 16);
  _exit(gTrap->close() == ECF_OK ? 0 : 1);
}

TEST(TrapFile, DumpFromASignalHandlerIsAppended) {
  klptest::TmpDir tmp;
  std::string file = tmp.path() + "MYDB.KLP.KCAP.1.2.DUMP";
  HSVTrapFile t;
  ASSERT_EQ(ECF_OK, t.open(file.c_str(), HSV_TRAPFILE_OPEN_OPTION));
  ASSERT_EQ(ECF_OK, t.write("earlier text\n", 13));
  ASSERT_EQ(ECF_OK, t.close());
  void* page = mmap(nullptr, 4096, PROT_NONE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  ASSERT_NE(MAP_FAILED, page);
  auto c = klptest::inChild(tmp.path(), [&] {
    static HSVTrapFile trap;
    if (trap.open(file.c_str(), HSV_TRAPFILE_OPEN_OPTION) | trap.seekToEnd()) return 1;
    gTrap = &trap;
    struct sigaction sa {};
    sa.sa_sigaction = dumpAndExit;
    sa.sa_flags = SA_SIGINFO;
    sigaction(SIGSEGV, &sa, nullptr);
    printf("%d", getpid());
    fflush(stdout);
    *static_cast<volatile int*>(page) = 1;  // traps
    return 3;
  });
  munmap(page, 4096);
  ASSERT_EQ(0, c.exitCode);
  std::string text = klptest::readFile(file);
  char addr[32];
  snprintf(addr, sizeof addr, "Fault address: %p\n", page);
  EXPECT_EQ(0u, text.find("earlier text\n*** Trap dump ***\nSignal: 11 (SIGSEGV)\nProcess id: " +
                          c.out + "\n")) << text;
  EXPECT_NE(std::string::npos, text.find(addr)) << text;
  size_t stack = text.find("Stack trace:\n");
  // backtrace_symbols_fd lines name the module and carry addresses.
  EXPECT_NE(std::string::npos, text.find("test_common_platform", stack)) << text;
  EXPECT_NE(std::string::npos, text.find("[0x", stack)) << text;
  EXPECT_EQ(text.size() - 16 - 25, text.find("*** End of trap dump ***\n***E**O**D**M***"));
  EXPECT_EQ(ECF_NOT_ATTACHED, t.write("x", 1));
  EXPECT_EQ(ECF_NOT_ATTACHED, t.dump(HSV_TRAPFILE_DUMP_OPTION, 11, nullptr, nullptr));
  EXPECT_EQ(ECF_NOT_FOUND, t.open("/nonexistent-dir/x.DUMP", HSV_TRAPFILE_OPEN_OPTION));
  EXPECT_FALSE(t.isValid());
  EXPECT_EQ(ECF_NOT_ATTACHED, t.close());
}

}  // namespace
