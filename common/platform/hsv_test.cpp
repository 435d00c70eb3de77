// Resource ids, codes, wait/post, time, libraries and the trap file.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <mqueue.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/syscall.h>

#include <atomic>
#include <cmath>
#include <cstring>
#include <ctime>
#include <string>
#include <thread>

#include "common/platform/hsv.h"
#include "common/platform/hsv_testutil.h"
#include "tests/testing/klptest.h"

using hsvtest::forkRun;
using hsvtest::waitChild;

namespace {

std::string printable(const HSVResID& id) {
  char buf[128];
  hsvResIDPrintable(id, buf, sizeof buf);
  return buf;
}

TEST(ResID, NamesAreTheFnv1aHashOfThePath) {
  // Published 64-bit FNV-1a values: "a" -> af63dc4c8601ec8c,
  // "foobar" -> 85944171f73967e8.
  HSVResID q{}, m{};
  ASSERT_EQ(hsvIPCGetQueResID("a", HSV_QUEUE_RESID_OPTION, &q), ECF_OK);
  EXPECT_STREQ(q.posixName(), "/klpq.af63dc4c8601ec8c");
  EXPECT_EQ(printable(q), "(mqueue, /klpq.af63dc4c8601ec8c, 48)");
  ASSERT_EQ(hsvIPCGetResID("foobar", HSV_MEMORY_RESID_OPTION, &m), ECF_OK);
  EXPECT_EQ(printable(m), "(shm, /klpm.85944171f73967e8, 109)");

  // No normalisation: a different spelling is a different object.
  HSVResID x{}, y{};
  ASSERT_EQ(hsvIPCGetQueResID("/tmp/A.IPC", 48, &x), ECF_OK);
  ASSERT_EQ(hsvIPCGetQueResID("/tmp//A.IPC", 48, &y), ECF_OK);
  EXPECT_STRNE(x.posixName(), y.posixName());

  EXPECT_EQ(hsvIPCGetQueResID(nullptr, 48, &x), ECF_INVALID_ARGUMENT);
  EXPECT_EQ(hsvIPCGetQueResID("", 48, &x), ECF_INVALID_ARGUMENT);
  EXPECT_EQ(hsvIPCGetResID("p", 109, nullptr), ECF_INVALID_ARGUMENT);
}

TEST(ResID, SameInEveryProcess) {
  klptest::TmpDir tmp;
  std::string path = tmp.path() + "MYDB.KLP.KCAP.IPC.CMD4711";
  HSVResID mine{};
  ASSERT_EQ(hsvIPCGetQueResID(path.c_str(), 48, &mine), ECF_OK);
  std::string expected = printable(mine);
  int fds[2];
  ASSERT_EQ(pipe(fds), 0);
  pid_t child = forkRun([&] {
    close(fds[0]);
    HSVResID id{};
    if (hsvIPCGetQueResID(path.c_str(), 48, &id) != ECF_OK) return 1;
    std::string s = printable(id);
    return write(fds[1], s.data(), s.size()) == static_cast<ssize_t>(s.size()) ? 0 : 2;
  });
  close(fds[1]);
  char buf[256] = {0};
  ssize_t n = 0, got = 0;
  while ((n = read(fds[0], buf + got, sizeof buf - 1 - got)) > 0) got += n;
  close(fds[0]);
  EXPECT_EQ(waitChild(child), 0);
  EXPECT_EQ(std::string(buf, got), expected);
}

TEST(ResID, PrintableNeverWritesPastTheBuffer) {
  HSVResID id{};
  ASSERT_EQ(hsvIPCGetQueResID("a", 48, &id), ECF_OK);
  char buf[16];
  memset(buf, '#', sizeof buf);
  hsvResIDPrintable(id, buf, 10);
  EXPECT_STREQ(buf, "(mqueue, ");
  for (size_t i = 10; i < sizeof buf; ++i) EXPECT_EQ(buf[i], '#') << i;
  hsvResIDPrintable(id, buf, 0);  // nothing to write into: untouched
  EXPECT_EQ(buf[0], '(');

  // Parts without their NUL are cut at their field size, not read past.
  HSVResID raw;
  memset(&raw, 'z', sizeof raw);
  char big[256];
  hsvResIDPrintable(raw, big, sizeof big);
  EXPECT_EQ(strlen(big), sizeof raw.part1 + sizeof raw.part2 + sizeof raw.part3 + 6);
}

TEST(Codes, TextsAndErrnoMapping) {
  const hsvRC named[] = {ECF_ACCESS_DENIED, ECF_NOT_FOUND,  ECF_INVALID_ARGUMENT, ECF_ALREADY_EXISTS,
                         ECF_MSG_TOO_BIG,   ECF_QUEUE_FULL, ECF_TIMEOUT,          ECF_SYSTEM_ERROR,
                         ECF_WAITPOST_NOT_INITIALIZED, ECF_NOT_OWNED};
  for (hsvRC c : named) {
    ASSERT_NE(ecfErrorGetDescription(c), nullptr);
    EXPECT_STRNE(ecfErrorGetDescription(c), "unknown platform error") << std::hex << c;
  }
  EXPECT_STRNE(ecfErrorGetDescription(ECF_NOT_FOUND), ecfErrorGetDescription(ECF_TIMEOUT));
  EXPECT_STREQ(ecfErrorGetDescription(0x12345678), "unknown platform error");

  EXPECT_EQ(hsvErrnoToECF(ENOENT), ECF_NOT_FOUND);
  EXPECT_EQ(hsvErrnoToECF(EEXIST), ECF_ALREADY_EXISTS);
  EXPECT_EQ(hsvErrnoToECF(EACCES), ECF_ACCESS_DENIED);
  EXPECT_EQ(hsvErrnoToECF(ENOMEM), ECF_NO_MEMORY);
  EXPECT_EQ(hsvErrnoToECF(EMFILE), ECF_LIMIT_REACHED);
  EXPECT_EQ(hsvErrnoToECF(ENFILE), ECF_LIMIT_REACHED);
  EXPECT_EQ(hsvErrnoToECF(ENOSPC), ECF_LIMIT_REACHED);
  EXPECT_EQ(hsvErrnoToECF(EMSGSIZE), ECF_MSG_TOO_BIG);
  EXPECT_EQ(hsvErrnoToECF(EINVAL), ECF_INVALID_ARGUMENT);
  EXPECT_EQ(hsvErrnoToECF(EXDEV), ECF_SYSTEM_ERROR);
}

// A queue or block made first under our name by someone else: only a private
// one of ours is used. A second user is not at hand in a test, but the mode
// such a user would have to grant us is, and is refused the same way.
TEST(Ownership, OnlyPrivateObjectsOfOursAreUsed) {
  struct Row {
    mode_t mode;
    hsvRC attach, create;
  };
  const Row rows[] = {
      {0600, ECF_OK, ECF_ALREADY_EXISTS},         {0666, ECF_NOT_OWNED, ECF_NOT_OWNED},
      {0640, ECF_NOT_OWNED, ECF_NOT_OWNED},       {0602, ECF_NOT_OWNED, ECF_NOT_OWNED},
      {0610, ECF_NOT_OWNED, ECF_NOT_OWNED},       {0400, ECF_ACCESS_DENIED, ECF_ALREADY_EXISTS},
  };
  klptest::TmpDir tmp;
  std::string path = tmp.path() + "MYDB.KLP.KCAP.IPC";
  HSVResID qid{}, mid{};
  ASSERT_EQ(hsvIPCGetQueResID(path.c_str(), HSV_QUEUE_RESID_OPTION, &qid), ECF_OK);
  ASSERT_EQ(hsvIPCGetResID(path.c_str(), HSV_MEMORY_RESID_OPTION, &mid), ECF_OK);
  for (const Row& r : rows) {
    SCOPED_TRACE(std::to_string(r.mode));
    mq_attr attr{};
    attr.mq_maxmsg = HSV_QUEUE_DEPTH;
    attr.mq_msgsize = HSV_MAX_MSG_SIZE;
    mqd_t raw = mq_open(qid.posixName(), O_RDWR | O_CREAT | O_EXCL, 0600, &attr);
    ASSERT_NE(raw, static_cast<mqd_t>(-1));
    ASSERT_EQ(fchmod(raw, r.mode), 0);
    HSVHIPCQueue q, q2;
    EXPECT_EQ(q.attach(qid), r.attach);
    EXPECT_EQ(q.isOpen(), r.attach == ECF_OK);
    EXPECT_EQ(q2.create(qid, HSV_MAX_MSG_SIZE, HSV_CREATE_OPTION), r.create);
    mq_close(raw);
    mq_unlink(qid.posixName());

    int fd = shm_open(mid.posixName(), O_RDWR | O_CREAT | O_EXCL, 0600);
    ASSERT_GE(fd, 0);
    ASSERT_EQ(ftruncate(fd, 4096), 0);
    ASSERT_EQ(fchmod(fd, r.mode), 0);
    HSVHIPCMemory m, m2;
    EXPECT_EQ(m.attach(mid), r.attach);
    EXPECT_EQ(m.getAddress() != nullptr, r.attach == ECF_OK);
    EXPECT_EQ(m2.create(mid, 4096, HSV_CREATE_OPTION), r.create);
    close(fd);
    shm_unlink(mid.posixName());
  }
  EXPECT_FALSE(klptest::queueExists(path));
  EXPECT_FALSE(klptest::memoryExists(path));
}

TEST(Waitpost, PostWaitAndTimeout) {
  HSVHIPCWaitpost wp;
  EXPECT_EQ(wp.wait(0), ECF_WAITPOST_NOT_INITIALIZED);
  EXPECT_EQ(wp.post(), ECF_WAITPOST_NOT_INITIALIZED);
  ASSERT_EQ(wp.create(HSV_CREATE_OPTION), ECF_OK);

  int64_t start = hsvtest::nowMs();
  EXPECT_EQ(wp.wait(100), 0x90000013u);
  EXPECT_GE(hsvtest::nowMs() - start, 95);

  // A post before the wait is kept for it, and consumed by it.
  EXPECT_EQ(wp.post(), ECF_OK);
  EXPECT_EQ(wp.wait(0), ECF_OK);
  EXPECT_EQ(wp.wait(0), ECF_TIMEOUT);
  EXPECT_EQ(wp.post(), ECF_OK);
  EXPECT_EQ(wp.wait(5000), ECF_OK);

  // A post from another thread wakes a waiter.
  std::thread poster([&] {
    hsvSleep(100);
    wp.post();
  });
  EXPECT_EQ(wp.wait(10000), ECF_OK);
  poster.join();
  EXPECT_EQ(wp.destroy(), ECF_OK);
  EXPECT_EQ(wp.wait(0), ECF_WAITPOST_NOT_INITIALIZED);
}

TEST(Waitpost, DestroyReleasesWaiters) {
  HSVHIPCWaitpost wp;
  ASSERT_EQ(wp.create(HSV_CREATE_OPTION), ECF_OK);
  std::atomic<int> started{0};
  std::atomic<hsvRC> result{ECF_OK};
  std::thread waiter([&] {
    started = 1;
    result = wp.wait(-1);
  });
  while (!started) hsvSleep(1);
  hsvSleep(50);
  EXPECT_EQ(wp.destroy(), ECF_OK);  // must not hang with the waiter inside
  waiter.join();
  EXPECT_EQ(result.load(), ECF_WAITPOST_NOT_INITIALIZED);
}

TEST(Waitpost, CallsRacingWithDestroyFindItClosed) {
  // Waits and posts that run while another thread destroys and re-creates
  // the object must see it closed or open, never freed state.
  HSVHIPCWaitpost wp;
  ASSERT_EQ(wp.create(HSV_CREATE_OPTION), ECF_OK);
  std::atomic<bool> done{false};
  std::thread user([&] {
    while (!done) {
      hsvRC rc = wp.wait(0);
      EXPECT_TRUE(rc == ECF_OK || rc == ECF_TIMEOUT || rc == ECF_WAITPOST_NOT_INITIALIZED) << rc;
      rc = wp.post();
      EXPECT_TRUE(rc == ECF_OK || rc == ECF_WAITPOST_NOT_INITIALIZED) << rc;
    }
  });
  for (int i = 0; i < 20000; ++i) {
    wp.destroy();
    wp.create(HSV_CREATE_OPTION);
  }
  done = true;
  user.join();
  EXPECT_EQ(wp.create(HSV_CREATE_OPTION), ECF_ALREADY_EXISTS);
}

TEST(Clock, TimeIdsAndSleep) {
  HSVTimeUTC t = hsvTimeGetUTC();
  EXPECT_LE(std::llabs(t.seconds - static_cast<int64_t>(time(nullptr))), 2);
  EXPECT_GE(t.microseconds, 0);
  EXPECT_LT(t.microseconds, 1000000);

  struct tm g {};
  ASSERT_TRUE(hsvTimeGmTime(951782400, &g));  // 2000-02-29 00:00:00 UTC
  EXPECT_EQ(g.tm_year, 100);
  EXPECT_EQ(g.tm_mon, 1);
  EXPECT_EQ(g.tm_mday, 29);
  struct tm l {};
  EXPECT_TRUE(hsvTimeLocalTime(t.seconds, &l));
  EXPECT_FALSE(hsvTimeGmTime(0, nullptr));

  EXPECT_EQ(hsvProcessID(), getpid());
  EXPECT_EQ(hsvThreadID(), static_cast<uint64_t>(syscall(SYS_gettid)));
  uint64_t other = 0;
  std::thread([&] { other = hsvThreadID(); }).join();
  EXPECT_NE(other, hsvThreadID());

  EXPECT_EQ(hsvOneTimeOnly(), ECF_OK);
  EXPECT_EQ(hsvOneTimeOnly(), ECF_OK);
}

void ignoreSignal(int) {}

TEST(Clock, SleepLastsThroughSignals) {
  struct sigaction sa {}, old{};
  sa.sa_handler = ignoreSignal;
  sigemptyset(&sa.sa_mask);
  ASSERT_EQ(sigaction(SIGUSR2, &sa, &old), 0);
  pthread_t self = pthread_self();
  std::thread poker([self] {
    for (int i = 0; i < 3; ++i) {
      hsvSleep(30);
      pthread_kill(self, SIGUSR2);
    }
  });
  int64_t start = hsvtest::nowMs();
  hsvSleep(250);
  EXPECT_GE(hsvtest::nowMs() - start, 245);
  poker.join();
  sigaction(SIGUSR2, &old, nullptr);
}

TEST(SharedLib, LoadsLibrariesAndResolvesSymbols) {
  HSVSharedLib c;
  ASSERT_EQ(c.load("libc.so.6", 4), ECF_OK) << c.lastError();
  auto len = reinterpret_cast<size_t (*)(const char*)>(c.getFuncAddress("strlen"));
  ASSERT_NE(len, nullptr);
  EXPECT_EQ(len("seven!!"), 7u);
  EXPECT_EQ(c.getFuncAddress("klp_no_such_symbol"), nullptr);
  EXPECT_NE(c.lastError()[0], '\0');
  EXPECT_EQ(c.load("libm.so.6", 0), ECF_ALREADY_EXISTS);  // would lose the first handle
  EXPECT_EQ(c.unload(), ECF_OK);
  EXPECT_FALSE(c.isLoaded());
  EXPECT_EQ(c.unload(), ECF_NOT_ATTACHED);

  HSVSharedLib m;
  ASSERT_EQ(m.load("libm.so.6", 0), ECF_OK) << m.lastError();
  auto cosine = reinterpret_cast<double (*)(double)>(m.getFuncAddress("cos"));
  ASSERT_NE(cosine, nullptr);
  EXPECT_DOUBLE_EQ(cosine(0.0), 1.0);

  HSVSharedLib missing;
  EXPECT_EQ(missing.load("libklp_no_such_library.so.9", 4), ECF_NOT_FOUND);
  EXPECT_NE(std::string(missing.lastError()).find("libklp_no_such_library"), std::string::npos);
  EXPECT_FALSE(missing.isLoaded());
  EXPECT_EQ(missing.getFuncAddress("cos"), nullptr);
  EXPECT_EQ(missing.load(nullptr, 0), ECF_INVALID_ARGUMENT);
}

HSVTrapFile* gTrap = nullptr;

void dumpAndExit(int sig, siginfo_t* info, void* uc) {
  gTrap->dump(HSV_TRAPFILE_DUMP_OPTION, sig, info, uc);
  static const char kEnd[] = "***E**O**D**M***";
  gTrap->write(kEnd, sizeof kEnd);
  gTrap->close();
  _exit(0);
}

TEST(TrapFile, DumpFromASignalHandlerIsAppended) {
  klptest::TmpDir tmp;
  std::string file = tmp.path() + "MYDB.KLP.KCAP.1.2.DUMP";
  {
    HSVTrapFile earlier;
    ASSERT_EQ(earlier.open(file.c_str(), HSV_TRAPFILE_OPEN_OPTION), ECF_OK);
    ASSERT_EQ(earlier.write("earlier text\n", 13), ECF_OK);
  }
  void* page = mmap(nullptr, 4096, PROT_NONE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  ASSERT_NE(page, MAP_FAILED);
  pid_t child = forkRun([&] {
    static HSVTrapFile trap;
    if (trap.open(file.c_str(), HSV_TRAPFILE_OPEN_OPTION) != ECF_OK) return 1;
    if (trap.seekToEnd() != ECF_OK || !trap.isValid()) return 2;
    gTrap = &trap;
    struct sigaction sa {};
    sa.sa_sigaction = dumpAndExit;
    sa.sa_flags = SA_SIGINFO;
    sigemptyset(&sa.sa_mask);
    sigaction(SIGSEGV, &sa, nullptr);
    *static_cast<volatile int*>(page) = 1;  // traps
    return 3;
  });
  int rc = waitChild(child);
  munmap(page, 4096);
  ASSERT_EQ(rc, 0);

  std::string text = klptest::readFile(file);
  EXPECT_EQ(text.rfind("earlier text\n", 0), 0u) << "dump must append";
  EXPECT_NE(text.find("Signal: 11 (SIGSEGV)"), std::string::npos) << text;
  EXPECT_NE(text.find("Process id: " + std::to_string(child) + "\n"), std::string::npos) << text;
  char addr[32];
  snprintf(addr, sizeof addr, "Fault address: %p\n", page);
  EXPECT_NE(text.find(addr), std::string::npos) << text;
  size_t stack = text.find("Stack trace:\n");
  ASSERT_NE(stack, std::string::npos) << text;
  // backtrace_symbols_fd lines name the module and carry addresses.
  EXPECT_NE(text.find("test_common_platform", stack), std::string::npos) << text;
  EXPECT_NE(text.find("[0x", stack), std::string::npos) << text;
  EXPECT_NE(text.find("*** End of trap dump ***\n"), std::string::npos);
  EXPECT_EQ(text.substr(text.size() - 17), std::string("***E**O**D**M***", 17));
}

TEST(TrapFile, ClosedOrBadFileIsReported) {
  HSVTrapFile t;
  EXPECT_FALSE(t.isValid());
  EXPECT_EQ(t.write("x", 1), ECF_NOT_ATTACHED);
  EXPECT_EQ(t.dump(HSV_TRAPFILE_DUMP_OPTION, 11, nullptr, nullptr), ECF_NOT_ATTACHED);
  EXPECT_EQ(t.open("/nonexistent-dir/x.DUMP", HSV_TRAPFILE_OPEN_OPTION), ECF_NOT_FOUND);
  EXPECT_FALSE(t.isValid());
  EXPECT_EQ(t.close(), ECF_NOT_ATTACHED);
}

}  // namespace
