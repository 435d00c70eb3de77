// Resource ids, wait/post, clocks, processes, libraries and the trap file.
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <sys/syscall.h>

#include <atomic>
#include <chrono>
#include <fstream>
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

// Published 64-bit FNV-1a values: "a" af63dc4c8601ec8c, "foobar" 85944171f73967e8.
TEST(ResID, NamesAreTheFnv1aHashOfThePath) {
  HSVResID q{}, m{}, raw;
  ASSERT_EQ(ECF_OK, hsvIPCGetQueResID("a", HSV_QUEUE_RESID_OPTION, &q));
  EXPECT_EQ("(mqueue, /klpq.af63dc4c8601ec8c, 48)", printable(q));
  ASSERT_EQ(ECF_OK, hsvIPCGetResID("foobar", HSV_MEMORY_RESID_OPTION, &m));
  EXPECT_EQ("(shm, /klpm.85944171f73967e8, 109)", printable(m));
  // No normalisation: another spelling is another object.
  ASSERT_EQ(ECF_OK, hsvIPCGetQueResID("/tmp//a", 48, &m) | hsvIPCGetQueResID("/tmp/a", 48, &q));
  EXPECT_STRNE(q.posixName(), m.posixName());
  for (hsvRC rc : {hsvIPCGetQueResID(nullptr, 48, &q), hsvIPCGetQueResID("", 48, &q),
                   hsvIPCGetResID("p", 109, nullptr)})
    EXPECT_EQ(ECF_INVALID_ARGUMENT, rc);
  // Never written past the room given, nor read past a part without its NUL.
  EXPECT_EQ("(mqueue, ", printable(q, 10));
  EXPECT_EQ(std::string(128, '#'), printable(q, 0));
  memset(&raw, 'z', sizeof raw);
  EXPECT_EQ("(" + std::string(16, 'z') + ", " + std::string(40, 'z') + ", " + std::string(24, 'z') + ")",
            printable(raw));
  EXPECT_STREQ("time-out", ecfErrorGetDescription(0x90000013));
  EXPECT_STREQ("unknown platform error", ecfErrorGetDescription(0x12345678));
}

TEST(Waitpost, PostsAreKeptOneAWaitAndDestroyWakesAWaiter) {
  HSVHIPCWaitpost wp;
  EXPECT_TRUE(wp.wait(0) == ECF_WAITPOST_NOT_INITIALIZED && wp.post() == ECF_WAITPOST_NOT_INITIALIZED);
  ASSERT_EQ(ECF_OK, wp.create(HSV_CREATE_OPTION));
  EXPECT_EQ(ECF_ALREADY_EXISTS, wp.create(HSV_CREATE_OPTION));
  auto start = std::chrono::steady_clock::now();
  EXPECT_EQ(0x90000013u, wp.wait(100));
  EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(95));
  ASSERT_TRUE(wp.post() == ECF_OK && wp.post() == ECF_OK);
  EXPECT_TRUE(wp.wait(0) == ECF_OK && wp.wait(5000) == ECF_OK && wp.wait(0) == ECF_TIMEOUT);
  std::thread poster([&] { hsvSleep(100), wp.post(); });
  EXPECT_EQ(ECF_OK, wp.wait(10000));
  poster.join();
  std::atomic<hsvRC> result{ECF_OK};  // woken with the closed code, not left for a post
  std::thread waiter([&] { result = wp.wait(-1); });
  hsvSleep(50);
  EXPECT_EQ(ECF_OK, wp.destroy());
  waiter.join();
  EXPECT_TRUE(result == ECF_WAITPOST_NOT_INITIALIZED && wp.wait(0) == ECF_WAITPOST_NOT_INITIALIZED);
}

// Calls racing with destroy and create find the object closed or open, never freed state.
TEST(Waitpost, CallsRacingWithDestroyFindItClosedOrOpen) {
  HSVHIPCWaitpost wp;
  ASSERT_EQ(ECF_OK, wp.create(HSV_CREATE_OPTION));
  std::atomic<bool> done{false};
  std::atomic<int> odd{0};
  std::thread user([&] {
    for (hsvRC w, p; !done; odd += (w != ECF_OK && w != ECF_TIMEOUT && w != ECF_WAITPOST_NOT_INITIALIZED) +
                                   (p != ECF_OK && p != ECF_WAITPOST_NOT_INITIALIZED))
      w = wp.wait(0), p = wp.post();
  });
  for (int i = 0; i < 20000; ++i) wp.destroy(), wp.create(HSV_CREATE_OPTION);
  done = true;
  user.join();
  EXPECT_EQ(0, odd.load());
}

TEST(Clock, TimeAndIds) {
  HSVTimeUTC t = hsvTimeGetUTC();
  struct tm local {};
  EXPECT_LE(std::llabs(t.seconds - static_cast<int64_t>(time(nullptr))), 2);
  EXPECT_TRUE(t.microseconds >= 0 && t.microseconds < 1000000 && hsvTimeLocalTime(t.seconds, &local));
  EXPECT_FALSE(hsvTimeGmTime(0, nullptr) || hsvTimeLocalTime(0, nullptr));
  EXPECT_TRUE(hsvThreadID() == static_cast<uint64_t>(syscall(SYS_gettid)) && hsvProcessID() == getpid());
  EXPECT_EQ(ECF_OK, hsvOneTimeOnly() | hsvOneTimeOnly());
}

// Helpers start with default signal dispositions, whatever the caller ignores;
// what cannot be run is not found.
TEST(Process, HelpersStartWithDefaultDispositions) {
  klptest::TmpDir tmp;
  std::ofstream(tmp.path() + "plain") << "exit 0\n";  // not executable
  const char* const term[] = {"sh", "-c", "kill -TERM $$; exit 3", nullptr};
  int32_t pid = 0;
  int code = 0;
  sighandler_t old = signal(SIGTERM, SIG_IGN);
  hsvRC started = hsvStartProcess("/bin/sh", term, &pid);
  signal(SIGTERM, old);
  ASSERT_EQ(ECF_OK, started);
  EXPECT_TRUE(hsvWaitProcess(pid, &code) == ECF_OK && code == -1);  // ended by the signal
  EXPECT_EQ(ECF_NOT_FOUND, hsvStartProcess((tmp.path() + "plain").c_str(), term, &pid));
  EXPECT_EQ(ECF_NOT_FOUND, hsvStartProcess("klp-no-such-program", term, &pid));
  EXPECT_EQ(ECF_INVALID_ARGUMENT, hsvStartProcess("", term, &pid));
}

TEST(SharedLib, LoadsLibrariesAndResolvesSymbols) {
  HSVSharedLib c, missing;
  ASSERT_EQ(ECF_OK, c.load("libc.so.6", 4)) << c.lastError();
  EXPECT_EQ(7u, reinterpret_cast<size_t (*)(const char*)>(c.getFuncAddress("strlen"))("seven!!"));
  EXPECT_TRUE(c.getFuncAddress("klp_no_such_symbol") == nullptr && c.lastError()[0] != '\0');
  EXPECT_EQ(ECF_ALREADY_EXISTS, c.load("libm.so.6", 0));  // would lose the first handle
  EXPECT_TRUE(c.unload() == ECF_OK && c.unload() == ECF_NOT_ATTACHED);
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
  std::ofstream(file) << "earlier text\n";
  void* page = mmap(nullptr, 4096, PROT_NONE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  time_t before = time(nullptr);
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
  char addr[64];
  snprintf(addr, sizeof addr, "Fault address: %p\nInstruction pointer: 0x", page);
  struct tm dumped {};  // the dump's own calendar arithmetic against the C library's
  ASSERT_NE(nullptr, strptime(text.c_str() + text.find("\nTime: ") + 7, "%Y-%m-%d %H:%M:%S", &dumped));
  EXPECT_TRUE(timegm(&dumped) >= before && timegm(&dumped) <= time(nullptr)) << text;
  EXPECT_EQ(0u, text.find("earlier text\n*** Trap dump ***\nSignal: 11 (SIGSEGV)\nProcess id: " + c.out + "\n"));
  size_t stack = text.find("Stack trace:\n");
  EXPECT_TRUE(text.find(addr) != std::string::npos && text.find("test_common_platform", stack) != std::string::npos &&
              text.find("[0x", stack) != std::string::npos) << text;
  EXPECT_EQ(text.size() - 16 - 25, text.find("*** End of trap dump ***\n***E**O**D**M***"));
  HSVTrapFile t;  // an empty file is at its end, whatever errno held
  ASSERT_EQ(ECF_OK, t.open((tmp.path() + "empty").c_str(), HSV_TRAPFILE_OPEN_OPTION));
  errno = ENOENT;
  EXPECT_TRUE(t.seekToEnd() == ECF_OK && t.close() == ECF_OK);
  EXPECT_TRUE(t.write("x", 1) == ECF_NOT_ATTACHED &&
              t.dump(HSV_TRAPFILE_DUMP_OPTION, 11, nullptr, nullptr) == ECF_NOT_ATTACHED);
  EXPECT_EQ(ECF_NOT_FOUND, t.open("/nonexistent-dir/x.DUMP", HSV_TRAPFILE_OPEN_OPTION));
  EXPECT_EQ(ECF_NOT_ATTACHED, t.close());
}

}  // namespace
