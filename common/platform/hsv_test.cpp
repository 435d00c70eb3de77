// The platform layer: ids, wait/post, clocks, processes, libraries, trap files and IPC.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <mqueue.h>
#include <sys/mman.h>
#include <sys/syscall.h>

#include <atomic>
#include <chrono>
#include <fstream>
#include <functional>
#include <future>
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
  for (hsvRC c = 0x90000000; c <= 0x90000401; ++c) ASSERT_NE(nullptr, ecfErrorGetDescription(c)) << c;  // printed with %s
}

TEST(Waitpost, PostsAreKeptOneAWaitAndDestroyWakesAWaiterAndRacingCalls) {
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
  // Calls racing with destroy and create find the object closed or open, never freed state.
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

TEST(Process, ClockIdsAndHelpersStartWithDefaultDispositions) {
  HSVTimeUTC t = hsvTimeGetUTC();
  struct tm local {};
  EXPECT_LE(std::llabs(t.seconds - static_cast<int64_t>(time(nullptr))), 2);
  EXPECT_TRUE(t.microseconds >= 0 && t.microseconds < 1000000 && hsvTimeLocalTime(t.seconds, &local));
  EXPECT_FALSE(hsvTimeGmTime(0, nullptr) || hsvTimeLocalTime(0, nullptr));
  EXPECT_TRUE(hsvThreadID() == static_cast<uint64_t>(syscall(SYS_gettid)) && hsvProcessID() == getpid());
  EXPECT_EQ(ECF_OK, hsvOneTimeOnly() | hsvOneTimeOnly());
  // Helpers start with default signal dispositions; what cannot be run is not found.
  klptest::TmpDir tmp;
  std::ofstream(tmp.path() + "plain") << "exit 0\n";  // not executable
  const char* const term[] = {"sh", "-c", "echo x || exit 4; kill -TERM $$; exit 3", nullptr};  // stdout writable
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
    sa.sa_sigaction = dumpAndExit, sa.sa_flags = SA_SIGINFO;
    sigaction(SIGSEGV, &sa, nullptr);
    printf("%d", getpid()), fflush(stdout);
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
  siginfo_t far{};  // an address of all sixteen hex digits
  far.si_addr = reinterpret_cast<void*>(0xfedcba9876543210u);
  EXPECT_TRUE(t.seekToEnd() == ECF_OK && t.dump(HSV_TRAPFILE_DUMP_OPTION, 11, &far, nullptr) == ECF_OK &&
              t.close() == ECF_OK);
  EXPECT_NE(std::string::npos, klptest::readFile(tmp.path() + "empty").find("Fault address: 0xfedcba9876543210\n"));
  EXPECT_TRUE(t.write("x", 1) == ECF_NOT_ATTACHED &&
              t.dump(HSV_TRAPFILE_DUMP_OPTION, 11, nullptr, nullptr) == ECF_NOT_ATTACHED);
  EXPECT_EQ(ECF_NOT_FOUND, t.open("/nonexistent-dir/x.DUMP", HSV_TRAPFILE_OPEN_OPTION));
  EXPECT_TRUE(t.open("", 0) == ECF_INVALID_ARGUMENT && t.open(nullptr, 0) == ECF_INVALID_ARGUMENT);
  EXPECT_EQ(ECF_NOT_ATTACHED, t.close());
}

// A queue and a block (not a page multiple: attach reports this size), gone at the end.
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

// More than the queue holds (the sender waits for room); a wait takes none; the same bytes.
TEST_F(IpcTest, MessagesAndBytesCrossProcessesWholeAndInOrder) {
  auto* p = static_cast<char*>(m.getAddress());
  EXPECT_TRUE(m.getSize() == kSize && std::string(p, kSize) == std::string(kSize, '\0'));
  memcpy(p, "from parent", 12);
  EXPECT_TRUE(q.waitForMessage(0) == ECF_TIMEOUT && q.waitForMessage(50) == ECF_TIMEOUT);
  auto sender = other([](HSVHIPCQueue& s, HSVHIPCMemory& o) {
    char* b = static_cast<char*>(o.getAddress());
    if (s.maxMsgSize() != HSV_MAX_MSG_SIZE || o.getSize() != kSize || memcmp(b, "from parent", 12)) return 1;
    memcpy(b + kSize - 11, "from child", 11);
    hsvSleep(150);  // not needed for the verdict: lets the wait below sleep
    for (int i = 0; i < 60; ++i)
      if (s.put(message(i).data(), message(i).size()) != ECF_OK) return 2;
    return o.detach() == ECF_OK ? 0 : 3;
  });
  EXPECT_TRUE(q.waitForMessage(10000) == ECF_OK && q.hasMessage() && q.waitForMessage(0) == ECF_OK);
  for (int i = 0; i < 60; ++i) {
    ASSERT_EQ(ECF_OK, q.get(buf.data(), buf.size(), &len, 10000)) << i;
    ASSERT_EQ(message(i), got()) << i;
  }
  EXPECT_EQ(0, sender.get().exitCode);
  EXPECT_FALSE(q.hasMessage());
  EXPECT_STREQ("from child", p + kSize - 11);
}

// Objects made first under our name: only private ones of ours are used (the mode another
// user would have to grant stands for that user; root opens a read-only one all the same).
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
    ASSERT_TRUE(raw >= 0 && fd >= 0 && ftruncate(fd, 4096) == 0 && fchmod(raw, r.mode) == 0 &&
                fchmod(fd, r.mode) == 0);
    HSVHIPCQueue q1, q2;
    HSVHIPCMemory m1, m2;
    EXPECT_TRUE(q1.attach(id) == r.attach && m1.attach(mid) == r.attach) << std::oct << r.mode;
    EXPECT_TRUE(q1.isOpen() == (r.attach == ECF_OK) && (m1.getAddress() != nullptr) == (r.attach == ECF_OK));
    EXPECT_EQ(r.create, q2.create(id, HSV_MAX_MSG_SIZE, HSV_CREATE_OPTION)) << std::oct << r.mode;
    EXPECT_EQ(r.create, m2.create(mid, 4096, HSV_CREATE_OPTION)) << std::oct << r.mode;
    mq_close(raw), close(fd), mq_unlink(id.posixName()), shm_unlink(mid.posixName());
  }
  ASSERT_EQ(ECF_OK, q.create(id, HSV_MAX_MSG_SIZE, 51) | m.create(mid, kSize, 51));
}

// Callers' lengths, buffers, ids and object state are checked; a refused get leaves the message.
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

// A signal (no SA_RESTART) must not cut a timed wait short; a full queue times out.
TEST_F(IpcTest, WaitsLastThroughSignals) {
  const std::pair<const char*, std::function<void()>> rows[] = {
      {"hsvSleep", [] { hsvSleep(250); }},
      {"get", [&] { EXPECT_EQ(ECF_TIMEOUT, q.get(buf.data(), buf.size(), &len, 250)); }},
      {"waitForMessage", [&] { EXPECT_EQ(ECF_TIMEOUT, q.waitForMessage(250)); }},
      {"putWait", [&] {
         for (int i = 0; i < HSV_QUEUE_DEPTH; ++i) ASSERT_EQ(ECF_OK, q.put(&i, sizeof i));
         EXPECT_TRUE(q.putWait(&len, sizeof len, 0) == ECF_QUEUE_FULL && q.putWait(&len, sizeof len, 250) == ECF_QUEUE_FULL);
       }}};
  struct sigaction sa {}, old{};
  sa.sa_handler = [](int) {};
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

TEST_F(IpcTest, ByteLockExcludesOtherProcesses) {
  struct Shared { uint8_t lock; uint64_t counter; uint32_t ready; };
  auto* s = static_cast<Shared*>(m.getAddress());
  auto work = [](HSVHIPCQueue&, HSVHIPCMemory& o) {
    auto* cs = static_cast<volatile Shared*>(o.getAddress());
    __atomic_fetch_add(&cs->ready, 1u, __ATOMIC_ACQ_REL);  // off once both are there
    for (int spins = 0; __atomic_load_n(&cs->ready, __ATOMIC_ACQUIRE) < 2; ++spins, hsvSleep(1))
      if (spins > 10000) return 2;
    for (int i = 0; i < 20000; ++i) {
      hsvByteLock(&cs->lock);
      uint64_t v = cs->counter;  // a plain read-modify-write with a pause: unguarded, counts get lost
      for (int spin = 0; spin < 20; ++spin) __asm__ __volatile__("");
      if (i % 512 == 0) sched_yield();
      cs->counter = v + 1;
      hsvByteLockRelease(&cs->lock);
    }
    return 0;
  };
  auto child = other(work);  // against this process: one child at a time, each with its own output
  EXPECT_EQ(0, work(q, m));
  EXPECT_TRUE(child.get().exitCode == 0 && s->counter == 2u * 20000);
  uint8_t first = hsvByteLockExchange(&s->lock), second = hsvByteLockExchange(&s->lock);
  hsvByteLockRelease(&s->lock);
  EXPECT_TRUE(first == 0 && second == 1 && s->lock == 0);  // the previous value; release stores 0
}

}  // namespace
