// Command client and control interface: status conversions, exchanges with a forked fake server.
#include "common/ipc/cmdapi.h"

#include <gtest/gtest.h>
#include <fcntl.h>
#include <fnmatch.h>
#include <mqueue.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <memory>
#include <optional>
#include <thread>

#include "common/env/klpenv.h"
#include "common/ipc/ipcmsg.h"
#include "common/msg/klplog.h"
#include "common/msg/msglogger.h"
#include "common/thread/klpthread.h"
#include "common/thread/recoverymgr.h"
#include "include/klpapi.h"
#include "tests/testing/klptest.h"
#include "xqpub/dispatch.h"
#include "xqpub/kcapcmdparms.h"
#include "xqpub/xqpubparms.h"

namespace {

using Ints = std::vector<int32_t>;
void put32(std::vector<char>& b, size_t off, int32_t v) { std::memcpy(b.data() + off, &v, 4); }
void put16(std::vector<char>& b, size_t off, uint16_t v) { std::memcpy(b.data() + off, &v, 2); }
int32_t get32(const char* p, size_t off) { int32_t v; std::memcpy(&v, p + off, 4); return v; }
bool has(const char* text, const char* what) { return std::strstr(text, what) != nullptr; }

// A STATUS payload: three header words, a 20-byte record per thread and the spare slot.
std::vector<char> statusPayload(const std::vector<std::pair<std::string, int32_t>>& threads,
                                int32_t claimedCount = -1) {
  std::vector<char> p(12 + 20 * (threads.size() + 1), 0);
  put32(p, 8, claimedCount >= 0 ? claimedCount : static_cast<int32_t>(threads.size()));
  for (size_t i = 0; i < threads.size(); ++i) {
    std::memcpy(p.data() + 12 + 20 * i, threads[i].first.c_str(), threads[i].first.size());
    put32(p, 12 + 20 * i + 16, threads[i].second);
  }
  return p;
}

TEST(CmdApi, ThreadKindsServerNamesAndMappedCodes) {
  // Names arrive cut to 14 characters: the first 14 of a longer kind name match, 13 do not.
  const std::pair<const char*, int32_t> kinds[] = {
      {"AdminThread", 1},   {"HoldLThread", 5},  {"PruneThread", 7},    {"WorkerThread", 8},
      {"MonitorThread", 6}, {"LogRdrThread", 9}, {"BRx0000A9", 4},      {"BRx0000B9", 3},
      {"BR", 3},            {"Admin", 0},        {"BehinderWorker", 2}, {"BehinderWorke", 0},
      {"BehinderWorkerThread", 2},               {"BehinderWorkeX", 0}};
  for (const auto& [name, kind] : kinds) EXPECT_EQ(klpThreadKind(name), kind) << name;
  char out[KLP_UNIQUE_NAME_SIZE], out2[KLP_UNIQUE_NAME_SIZE];
  ASSERT_EQ(klpBuildServerName(KLP_KIND_KCAP, "mydb", "klp.", out, sizeof(out)) |
                klpBuildServerName(KLP_KIND_APP, "db1 junk", "qrs\0junk", out2, sizeof(out2)), 0);
  EXPECT_EQ(std::string(out) + " " + out2, "MYDB.KLP.KCAP DB1.QRS.APP");
  EXPECT_EQ(klpBuildServerName(KLP_KIND_MON, " x", "s", out, sizeof(out)), KLP_API_NO_SERVER);
  EXPECT_EQ(klpBuildServerName(KLP_KIND_MON, "x", "", out, sizeof(out)), KLP_API_NO_SCHEMA);
  EXPECT_EQ(klpBuildServerName(6, "x", "s", out, sizeof(out)), KLP_API_BAD_KIND);
  std::string a(128, 'a'), b(128, 'b');  // 128 characters without terminator are read to 128
  EXPECT_EQ(klpBuildServerName(KLP_KIND_CAP, a.data(), b.data(), out, sizeof(out)), KLP_API_BAD_NAME);
  const int mapped[][2] = {{824, 1000}, {815, 2013}, {804, 2014}, {805, 2015},
                           {816, 2016}, {825, 2017}, {817, 817},  {1003, 1003}};
  for (const auto& m : mapped) EXPECT_EQ(klpMapCmdRc(m[0]), m[1]) << m[0];
}

TEST(CmdApiStatusData, Format1FromThreadRecords) {
  auto p = statusPayload({{"AdminThread", 4}, {"BRx0000A9", 5}, {"BehinderWorker", 8}});
  std::vector<char> out(88, 0x55);
  int32_t required = 0;
  auto conv = [&](const std::vector<char>& q, size_t len, size_t outLen) {
    std::fill(out.begin(), out.end(), 0x55);
    return klpStatusFromThreads(q.data(), len, out.data(), outLen, &required);
  };
  ASSERT_EQ(conv(p, p.size(), 80), 0);
  EXPECT_EQ(required, 80);
  EXPECT_STREQ(out.data() + 8, "AdminThread");  // records of 24 bytes: name, kind, state
  EXPECT_EQ((Ints{get32(out.data(), 0), get32(out.data(), 4), get32(out.data(), 24), get32(out.data(), 28),
                  get32(out.data(), 48), get32(out.data(), 72), get32(out.data(), 76)}), (Ints{1, 3, 1, 4, 4, 2, 8}));
  // 56 bytes hold two records: filled, the rest refused with 1001.
  ASSERT_EQ(conv(p, p.size(), 56), 1001);
  EXPECT_EQ((Ints{required, get32(out.data(), 4)}), (Ints{80, 2}));
  EXPECT_EQ(std::vector<char>(out.begin() + 56, out.end()), std::vector<char>(32, 0x55));
  ASSERT_EQ(conv(statusPayload({}), 32, 32), 0);
  EXPECT_EQ((Ints{required, get32(out.data(), 4)}), (Ints{32, 0}));
  // Counts beyond the records carried, truncated and unterminated payloads.
  auto claims3 = statusPayload({{"AdminThread", 4}}, 3), negative = statusPayload({});
  put32(negative, 8, -1);
  EXPECT_EQ(conv(claims3, claims3.size(), 88), KLP_API_BAD_REPLY);
  EXPECT_EQ(conv(claims3, 11, 88), KLP_API_BAD_REPLY);
  EXPECT_EQ(conv(p, p.size(), 4), 1001);  // not even the header fits
  EXPECT_EQ(out, std::vector<char>(88, 0x55));
  EXPECT_EQ(conv(negative, negative.size(), 88), KLP_API_BAD_REPLY);
  EXPECT_EQ(conv(statusPayload({{"A", 1}, {"B", 2}}), 12 + 40, 88), 0);  // no spare slot
  auto unterminated = statusPayload({{"", 4}});
  std::memset(unterminated.data() + 12, 'N', 16);
  ASSERT_EQ(conv(unterminated, unterminated.size(), 88), 0);
  EXPECT_EQ(std::string(out.data() + 8), std::string(15, 'N'));
}

std::vector<char> kcapPayload() {
  std::vector<char> p(400, 0);
  put32(p, 12, 90061);
  put32(p, 20, 7);
  std::memcpy(p.data() + 24, "2024-01-02-03.04.05.123456", 26);
  std::memcpy(p.data() + 51, "\x00\x0a\xbc\xde\xf0\x12\x34\xff", 8);
  put32(p, 64, 4096);
  put16(p, 16, 100);  // log file at 100
  put16(p, 100, 12);
  std::memcpy(p.data() + 102, "/var/log/kcp", 12);
  put16(p, 68, 200);  // section at 200: fields A and B, then its text
  std::memset(p.data() + 200, 'A', 30);
  std::memset(p.data() + 230, 'B', 30);
  put16(p, 260, 5);
  std::memcpy(p.data() + 262, "hello", 5);
  return p;
}

// Fields come from their offsets; one pointing outside the payload spoils the whole reply.
TEST(CmdApiStatusData, Format3FromItsOffsetsOrNothing) {
  const struct {
    std::vector<std::pair<size_t, uint16_t>> words;  // 16-bit words changed
    size_t len;                                      // payload length
    int rc;
    const char *logFile = "", *sectionText = "";
    size_t outLen = 2224;
  } cases[] = {
      {{}, 400, 0, "/var/log/kcp", "hello"},
      {{{16, 0}, {68, 0}, {60, 60000}}, 400, 0, "", ""},  // no log file, no section
      {{{16, 500}, {500, 1500}, {68, 0}}, 2002, 0, nullptr, ""},  // a long name is cut to its field
      {{{16, 399}}, 400, 2017},   // log file length word past the end
      {{{100, 60000}}, 400, 2017},  // log file text past the end
      {{{68, 380}}, 400, 2017},   // section fields past the end
      {{{260, 400}}, 400, 2017},  // section text past the end
      {{}, 69, 2017},             // fixed fields cut short
      {{}, 400, 1001, "", "", 2223},  // a buffer one byte short gets nothing
  };
  for (const auto& c : cases) {
    auto p = kcapPayload();
    p.resize(c.len, 'x');
    for (const auto& [at, value] : c.words) put16(p, at, value);
    std::vector<char> out(c.outLen, 0x55);
    int32_t required = 0;
    EXPECT_EQ(klpStatusFromKcap(p.data(), p.size(), out.data(), out.size(), &required), c.rc) << c.len;
    EXPECT_EQ(required, 2224);
    if (c.rc != 0) {
      EXPECT_EQ(out, std::vector<char>(c.outLen, 0x55));
      continue;
    }
    klpStatusFmt3 s;
    std::memcpy(&s, out.data(), sizeof(s));
    EXPECT_EQ((Ints{s.format, s.upTime, s.activeSubs, s.currentMemory}), (Ints{3, 90061, 7, 4096}));
    EXPECT_STREQ(s.currentLogTime, "2024-01-02-03.04.05.123456");
    EXPECT_STREQ(s.allPublishedLsn, "000ABCDEF01234FF");
    EXPECT_EQ(std::string(s.logFile), c.logFile ? c.logFile : std::string(1027, 'x'));
    EXPECT_STREQ(s.sectionText, c.sectionText);
    EXPECT_EQ(std::string(s.sectionA, 30) + std::string(s.sectionB, 30),
              *c.sectionText ? std::string(30, 'A') + std::string(30, 'B') : std::string(60, '\0'));
  }
}

// KAPP records with a 16-bit value to widen, 64-bit ones to cut, an unterminated text; the header's text last.
std::vector<char> kappPayload(int records) {
  std::vector<char> p(32 + 12296 * static_cast<size_t>(records) + 64, 0);
  for (auto [at, v] : {std::pair{12, records}, {16, 111}, {24, 222}, {28, 333}}) put32(p, at, v);
  put16(p, 20, static_cast<uint16_t>(p.size() - 20));
  put16(p, p.size() - 20, 4);
  std::memcpy(p.data() + p.size() - 18, "QMGR", 4);
  for (int r = 0; r < records; ++r) {
    size_t b = 32 + 12296 * static_cast<size_t>(r);
    std::memset(p.data() + b, 'a' + r, 48);
    for (size_t at : {52, 240, 244, 256, 260, 264, 268, 272, 276, 280, 284}) put32(p, b + at, at);
    put16(p, b + 248, static_cast<uint16_t>(-5));
    put32(p, b + 260, 1);  // high half of the 64-bit value at 256
    std::memset(p.data() + b + 3289, 'z', 3001);
    std::memcpy(p.data() + b + 9291, "fourth", 6);
  }
  return p;
}

TEST(CmdApiStatusData, Format2RecordsCopiedWidenedAndCut) {
  auto p = kappPayload(2);
  std::vector<char> out(1048 + 2 * 12272, 0x55);
  int32_t required = 0;
  ASSERT_EQ(klpStatusFromKapp(p.data(), p.size(), out.data(), out.size(), &required), 0);
  klpStatusFmt2 h;
  std::memcpy(&h, out.data(), sizeof(h));
  EXPECT_EQ((Ints{h.format, h.zero, h.count, h.value8, h.value1040, h.value1044}),
            (Ints{2, 0, 2, 111, 222, 333}));
  EXPECT_STREQ(h.text, "QMGR");
  auto r = std::make_unique<klpStatusFmt2Record>();
  std::memcpy(r.get(), out.data() + 1048 + 12272, sizeof(*r));
  EXPECT_EQ(std::string(r->ident, 48), std::string(48, 'b'));
  EXPECT_EQ((Ints{r->value52, r->value240, r->value244, r->value248, r->value252, r->value256,
                  r->value260, r->value264}), (Ints{52, 240, 244, -5, 256, 264, 272, 280}));
  EXPECT_EQ(std::strlen(r->text3269), 3000u);
  EXPECT_STREQ(r->text9271, "fourth");
  // Room for one record: that one is filled, still rc 0; below 13320 nothing is written.
  ASSERT_EQ(klpStatusFromKapp(p.data(), p.size(), out.data(), 13320, &required), 0);
  EXPECT_EQ(get32(out.data(), 4), 1);
  std::vector<char> tiny(13319, 0x55);
  ASSERT_EQ(klpStatusFromKapp(p.data(), p.size(), tiny.data(), tiny.size(), &required), 0);
  EXPECT_EQ(tiny, std::vector<char>(13319, 0x55));
  put32(p, 12, 3);  // more records claimed than carried
  EXPECT_EQ(klpStatusFromKapp(p.data(), p.size(), out.data(), out.size(), &required), 2017);
  p = kappPayload(0);  // a text beyond the payload
  put16(p, 20, static_cast<uint16_t>(p.size() - 1));
  EXPECT_EQ(klpStatusFromKapp(p.data(), p.size(), out.data(), out.size(), &required), 2017);
}

// Messages recorded, the main thread known to recovery, a private IPC directory; useParms() for CHGPARMS.
class CmdApiExchange : public ::testing::Test {
 protected:
  static void SetUpTestSuite() { klpEnsureMainThread(); }
  void SetUp() override { ASSERT_EQ(klpEnvClear(klpGetEnv()), 0); }
  void TearDown() override {
    klpEnvClear(klpGetEnv());
    if (cmd_) klpSetCurrentParms(saved_);
  }
  void useParms() {
    ParmEntry ct[KCAPCMD_PARM_COUNT], st[XQPUB_PARM_COUNT];
    buildKCapCmdParmTable(ct);
    buildXqpubParmTable(st);
    int rc1 = 0, rc2 = 0;
    cmd_ = std::make_unique<kCapCmdParmClass>(ct, KCAPCMD_PARM_COUNT, &rc1);
    server_ = std::make_unique<xqpubParms>(st, XQPUB_PARM_COUNT, &rc2);
    ASSERT_EQ(rc1 | rc2, 0);
    cmd_->setServerParms(server_.get());
    saved_ = klpGetCurrentParms();
    klpSetCurrentParms(cmd_.get());
  }
  std::string replyPath(const std::string& server) {
    return tmp_.path() + server + ".IPC.CMD" + std::to_string(getpid());
  }
  klptest::TmpDir tmp_;
  klptest::LogCapture log_;
  std::unique_ptr<kCapCmdParmClass> cmd_;
  std::unique_ptr<xqpubParms> server_;
  klpParmClass* saved_ = nullptr;
};

// A server in a forked child, its queue made before the fork; respond's answers or-ed into its exit code.
// Descriptors the process holds (queues are descriptors too).
size_t openFiles() {
  std::filesystem::directory_iterator fds("/proc/self/fd");
  return static_cast<size_t>(std::distance(begin(fds), end(fds)));
}

class FakeServer {
 public:
  FakeServer(const std::string& dir, const std::string& name) : dir_(dir), name_(name) {
    HSVResID id;
    EXPECT_EQ(hsvIPCGetQueResID((dir + name + ".IPC").c_str(), HSV_QUEUE_RESID_OPTION, &id), ECF_OK);
    EXPECT_EQ(queue_.create(id, HSV_MAX_MSG_SIZE, HSV_CREATE_OPTION), ECF_OK);
  }
  ~FakeServer() {
    if (child_ > 0 && kill(child_, SIGKILL) == 0) waitpid(child_, nullptr, 0);
    queue_.destroy();
  }
  void start(int requests, const std::function<int(const IpcMsgView&)>& respond) {
    fflush(stdout);
    if ((child_ = fork()) != 0) return;
    // The reply sender names the reply queue by this process's prefix.
    std::snprintf(klpGetEnv()->appVersion.rel.uniqueName, KLP_UNIQUE_NAME_SIZE, "%s", name_.c_str());
    klpThread::prologue(klpMainThread());
    int code = 0;
    for (int i = 0; i < requests; ++i) {
      char buf[HSV_MAX_MSG_SIZE];
      size_t got = 0;
      IpcMsgView view;
      if (queue_.get(buf, sizeof(buf), &got, 20000) != ECF_OK || ipcDecodeMsg(buf, got, &view)) _exit(90);
      code |= respond(view);
    }
    _exit(code);
  }
  int finish() {  // the child's own gets are bounded
    int status = 0;
    bool reaped = child_ > 0 && waitpid(child_, &status, 0) == child_;
    child_ = -1;
    return reaped && WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }
  bool hasRequest() { return queue_.hasMessage(); }
  int putRaw(int32_t pid, const std::vector<char>& bytes) {
    char path[2048];
    ipcReplyQueuePath(path, sizeof(path), dir_.c_str(), name_.c_str(), pid);
    HSVResID id;
    HSVHIPCQueue q;
    if (hsvIPCGetQueResID(path, HSV_QUEUE_RESID_OPTION, &id) != ECF_OK || q.attach(id) != ECF_OK)
      return 80;
    int rc = q.putWait(bytes.data(), bytes.size(), 1000) == ECF_OK ? 0 : 82;  // 1 s for room
    q.detach();
    return rc;
  }
  static int reply(const IpcMsgView& req, const std::vector<char>& payload) {
    IpcMsg* msg = nullptr;
    if (createReplyMsg(&msg, IPC_HEADER_SIZE + payload.size(), req.header.func, getpid())) return 70;
    msg->subFunc = req.header.subFunc;
    if (!payload.empty()) std::memcpy(msg->payload(), payload.data(), payload.size());
    int rc = KLPResponseFunc(req.header.senderPid, msg);
    freeIpcMsg(msg);
    return rc == 0 ? 0 : 71;
  }

 private:
  std::string dir_, name_;
  HSVHIPCQueue queue_;
  pid_t child_ = -1;
};

std::vector<char> rawMsg(int32_t func, const std::vector<char>& payload, int32_t pieceCount,
                         int32_t pieceNo, int32_t total, int32_t version = 1) {
  std::vector<char> m(IPC_HEADER_SIZE, 0);
  std::memcpy(m.data(), "IPC:", 4);
  const int32_t words[] = {version, static_cast<int32_t>(m.size() + payload.size()), func, 0,
                           getpid(), 0, pieceCount, pieceNo, total};
  std::memcpy(m.data() + 8, words, sizeof words);
  m.insert(m.end(), payload.begin(), payload.end());
  return m;
}

// The records logged since the last look, one line each, match pattern.
testing::AssertionResult logged(klptest::LogCapture& log, const std::string& pattern) {
  std::string got;
  for (const auto& r : log.take()) got += (got.empty() ? "" : "\n") + r;
  if (fnmatch(pattern.c_str(), got.c_str(), 0) == 0) return testing::AssertionSuccess();
  return testing::AssertionFailure() << got;
}

// What the client's routines log; a stale reply queue of our name, holding a message, is replaced.
TEST_F(CmdApiExchange, EachRoutineLogsItsRecords) {
  useParms();
  ASSERT_EQ(cmd_->addChgParm(30, "1000") | cmd_->addChgParm(16, "200"), 0);
  std::string stale = replyPath("S1.KLP.KCAP");
  HSVResID id;
  HSVHIPCQueue old;
  ASSERT_EQ(hsvIPCGetQueResID(stale.c_str(), HSV_QUEUE_RESID_OPTION, &id), ECF_OK);
  ASSERT_EQ(old.create(id, HSV_MAX_MSG_SIZE, HSV_CREATE_OPTION), ECF_OK);
  auto junk = rawMsg(15, statusPayload({{"OldThread", 1}}), 1, 0, 0);
  ASSERT_EQ(old.put(junk.data(), junk.size()), ECF_OK);
  old.detach();
  const std::string q = "(mqueue, /klpq.*, 48)", held = "592 cmdAPIFunc 1 " + q + "\n594 cmdAPIFunc 1 " + q;
  const struct { int func, rc; std::string records; } rows[] = {
      {15, 0, held + "\n520 printState 2 AdminThread|is doing work\n520 printState 2 HoldLThread|is resting"},
      {14, 0, held + "\n522 cmdAPIFunc 2 STOP"},
      {20, 0, held + "\n523 cmdAPIFunc 2 COMMIT_INTERVAL|1000\n523 cmdAPIFunc 2 SLEEP_INTERVAL|200"},
      // A reply claiming more threads than it carries is not read beyond its end.
      {15, 817, held + "\n589 cmdAPIFunc 1 cmdAPIFunc|817|printState\n"
                       "8999 cmdAPIFunc 1 thread records beyond the reply*"},
  };
  FakeServer srv(tmp_.path(), "S1.KLP.KCAP");
  int n = 0;
  srv.start(5, [&](const IpcMsgView& req) {
    if (req.header.func == 20)  // echoed; every value travels with its NUL
      return FakeServer::reply(req, std::vector<char>(req.payload, req.payload + req.payloadLen));
    bool lie = req.header.func == 15 && n++ > 0;
    return FakeServer::reply(req, req.header.func == 15 ? statusPayload({{"AdminThread", 4},
                                                          {"HoldLThread", 5}}, lie ? 50 : -1)
                                                        : std::vector<char>{});
  });
  for (const auto& r : rows) {
    EXPECT_EQ(cmdAPIFunc("S1.KLP.KCAP", r.func, nullptr, nullptr, nullptr), r.rc) << r.func;
    EXPECT_TRUE(logged(log_, r.records));
  }
  EXPECT_EQ(srv.finish(), 0);
  EXPECT_FALSE(klptest::queueExists(stale));
  // A name cut to fit would address some other server.
  EXPECT_EQ(KLPMonFunc(std::string(220, 'S').c_str(), "KLP.MON", nullptr), 2009);
  EXPECT_TRUE(logged(log_, "589 KLPMonFunc 1 KLPMonFunc|2009|server name\n8999 KLPMonFunc 1 the server "
                           "name and its suffix do not fit a server name*"));
  // Hand-made queues: open to others refused at once; too small refuses the put; a foreign reply queue kept.
  const std::string pid = std::to_string(getpid());
  const struct { const char *server, *suffix; mode_t mode; long msgSize; int rc; std::string records; }
      queues[] = {
      {"S2.KLP.CAP", ".IPC", 0666, HSV_MAX_MSG_SIZE, 815,
       "506 cmdAPIFunc 1 Capture\n597 cmdAPIFunc 1 " + q + "|*S2.KLP.CAP.IPC|object belongs to another user or is "
                                                          "open to group or others"},
      {"S3.KLP.MON", ".IPC", 0600, 16, 805, held + "\n508 cmdAPIFunc 1 \\*\n601 cmdAPIFunc 1 " + q + "|*S3.KLP.MON.IPC|*"},
      {"S4.KLP.APP", ".IPC.CMD", 0666, HSV_MAX_MSG_SIZE, 804,
       "592 cmdAPIFunc 1 " + q + "\n596 cmdAPIFunc 1 " + q + "|*S4.KLP.APP.IPC.CMD" + pid +
           "|object belongs to another user or is open to group or others\n507 cmdAPIFunc 1 \\*"},
  };
  for (const auto& c : queues) {
    std::string path = tmp_.path() + c.server + c.suffix + (c.rc == 804 ? pid : "");
    std::optional<FakeServer> server;
    if (c.rc == 804) server.emplace(tmp_.path(), c.server);
    ASSERT_EQ(hsvIPCGetQueResID(path.c_str(), HSV_QUEUE_RESID_OPTION, &id), ECF_OK);
    mq_attr attr{0, HSV_QUEUE_DEPTH, c.msgSize, 0, {}};
    mqd_t raw = mq_open(id.posixName(), O_RDWR | O_CREAT | O_EXCL, 0600, &attr);
    ASSERT_NE(raw, static_cast<mqd_t>(-1));
    ASSERT_EQ(fchmod(raw, c.mode), 0);
    auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(cmdAPIFunc(c.server, 14, nullptr, nullptr, nullptr), c.rc);
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(4));
    EXPECT_TRUE(logged(log_, c.records));
    mq_close(raw);
    mq_unlink(id.posixName());
  }
}

// Broken pieces and a wrong version are refused, nothing handed over; a late reply to another code is dropped.
TEST_F(CmdApiExchange, BrokenRepliesAreRefusedLateOnesDroppedAndCallersTakeTurns) {
  std::vector<char> first(4052, 'a'), rest(100, 'b');
  const struct {
    int32_t func;
    std::vector<std::vector<char>> put;  // raw messages, then (rc 0) the answer
    int rc;
    std::vector<char> answer;
    const char* text;  // in the captured messages
  } cases[] = {
      {60, {rawMsg(60, first, 2, 1, 4152), rawMsg(60, rest, 2, 3, 4152)}, 816, {}, "KLP0589"},
      {60, {rawMsg(60, first, 2, 1, 100000)}, 816, {}, "KLP0589"},  // two pieces cannot carry it
      {14, {rawMsg(14, {}, 1, 0, 0, 2)}, 825, {}, ""},
      {60, {rawMsg(14, {}, 1, 0, 0)}, 0, kcapPayload(), ""},
      {15, {rawMsg(61, first, 2, 1, 4152), rawMsg(61, rest, 2, 2, 4152)}, 0, statusPayload({}), ""},
  };
  FakeServer srv(tmp_.path(), "S1.KLP.KCAP");
  size_t n = 0;
  srv.start(std::size(cases) + 2, [&](const IpcMsgView& req) {
    if (n++ >= std::size(cases)) {  // the first of two at once waits (0.5 s at most) for the second
      for (int i = 0; n == std::size(cases) + 1 && i < 50 && !srv.hasRequest(); ++i) usleep(10000);
      return FakeServer::reply(req, req.header.func == 60 ? kcapPayload() : std::vector<char>{});
    }
    const auto& c = cases[n - 1];
    int rc = 0;
    for (size_t i = 0; i < c.put.size() && rc == 0; ++i) rc = srv.putRaw(req.header.senderPid, c.put[i]);
    return c.rc == 0 ? rc | FakeServer::reply(req, c.answer) : rc;
  });
  for (const auto& c : cases) {
    char* reply = nullptr;
    klpMsgCapture cap{};
    ASSERT_EQ(cmdAPIFunc("S1.KLP.KCAP", c.func, nullptr, &reply, &cap), c.rc) << c.func;
    EXPECT_EQ(c.rc == 0, reply != nullptr);
    EXPECT_TRUE(has(cap.text, c.text)) << cap.text;
    if (reply) { EXPECT_EQ(std::vector<char>(reply + 8, reply + 8 + get32(reply, 4)), c.answer) << c.func; }
    std::free(reply);
    EXPECT_FALSE(klptest::queueExists(replyPath("S1.KLP.KCAP")));
  }
  // Two threads calling at once take turns: the reply queue is named by the process.
  int rc[2] = {-1, -1}, len[2] = {-1, -1};
  auto call = [&](int i, int func) {
    char* reply = nullptr;
    rc[i] = cmdAPIFunc("S1.KLP.KCAP", func, nullptr, &reply, nullptr);
    if (reply) len[i] = get32(reply, 4);
    std::free(reply);
  };
  std::thread other(call, 1, 14);
  call(0, 60);
  other.join();
  EXPECT_EQ(srv.finish(), 0);
  EXPECT_EQ((Ints{rc[0], rc[1], len[0], len[1]}), (Ints{0, 0, 400, 0}));
}

// Each kind asked its own question, whole replies converted (buffer allocated when none); sizes from "klpSISize: ".
TEST_F(CmdApiExchange, CollectorAndStatusSizeConvertWholeRepliesOnly) {
  auto sizeReply = [](const char* text, int32_t count, size_t len = 16) {
    std::vector<char> p(16, 0);
    std::memcpy(p.data(), text, 12);
    put32(p, 12, count);
    p.resize(len);
    return p;
  };
  const struct {
    int32_t kind, func;
    std::vector<char> payload;
    size_t bufferSize;  // 0: the collector allocates; -1: a size query
    int rc;
    int32_t required;  // or the status size
    int16_t format = 0;
  } cases[] = {
      {KLP_KIND_KAPP, 61, kappPayload(2), 1048 + 2 * 12272, 0, 13320 + 12272, 2},
      {KLP_KIND_KCAP, 60, kcapPayload(), 0, 0, 2224, 3},
      {KLP_KIND_CAP, 15, statusPayload({{"AdminThread", 4}}), 0, 0, 32, 1},
      {KLP_KIND_APP, 15, statusPayload({{"AdminThread", 4}}, 3), 200, 2017, 0, 0},
      {KLP_KIND_MON, 59, sizeReply("klpSISize: ", 3), size_t(-1), 0, 80},
      {KLP_KIND_MON, 59, sizeReply("klpSISize: ", 0), size_t(-1), 0, 32},
      {KLP_KIND_KAPP, 62, sizeReply("klpSISize: ", 2), size_t(-1), 0, 1048 + 2 * 12272},
      {KLP_KIND_MON, 59, sizeReply("klpSIsize: ", 3), size_t(-1), 2017, 0},
      {KLP_KIND_MON, 59, sizeReply("klpSISize: ", 3, 15), size_t(-1), 2017, 0},
      {KLP_KIND_CAP, 59, sizeReply("klpSISize: ", -1), size_t(-1), 2017, 0},
  };
  const char* words[] = {"", "APP", "KAPP", "CAP", "KCAP", "MON"};
  size_t fds = openFiles();  // every exchange lets go of both queues
  for (const auto& c : cases) {
    FakeServer srv(tmp_.path(), std::string("S1.KLP.") + words[c.kind]);
    srv.start(1, [&](const IpcMsgView& req) {
      return req.header.func == c.func ? FakeServer::reply(req, c.payload) : 62;
    });
    klpReleaseInfo rel{c.kind, 9, 1, 0};
    bool size = c.bufferSize == size_t(-1);
    std::vector<char> out(size ? 0 : c.bufferSize);
    void* buffer = c.bufferSize && !size ? out.data() : nullptr;
    klpStatusRequest req{"s1", "klp.", {}, 0, buffer, static_cast<int32_t>(out.size()), 0};
    klpResultBlock res{};
    klpMsgCapture cap{};
    EXPECT_EQ(size ? klpGetStatusSize(&rel, &req, &res) : klpCollectStatus(&rel, &req, &res, &cap), c.rc);
    EXPECT_EQ(srv.finish(), 0) << c.func;
    EXPECT_EQ(res.rc, c.rc);
    EXPECT_EQ(size ? req.statusSize : req.requiredSize, c.required) << c.func;
    int16_t format = 0;
    if (req.buffer && c.rc == 0) std::memcpy(&format, req.buffer, sizeof(format));
    EXPECT_EQ(format, c.format) << c.func;
    EXPECT_EQ(has(res.text, "KLP0589") && has(res.text, "2017"), c.rc != 0) << res.text;
    if (c.bufferSize == 0) std::free(req.buffer);
  }
  EXPECT_EQ(openFiles(), fds);
  klpResultBlock res{};
  EXPECT_EQ(klpCollectStatus(nullptr, nullptr, &res, nullptr), 2001);
  EXPECT_EQ(res.rc, 2001);
}

// A logger that raises SIGINT once message `at` is composed.
class SignallingLogger : public msgLoggerU {
 public:
  explicit SignallingLogger(int at) : msgLoggerU(10, 0), at_(at) { loadBuiltinMsgs(builtinMsgTable); }
  void composeKlpMsg(logMsg* record) override {
    msgLoggerU::composeKlpMsg(record);
    if (record->msgNumber == at_) raise(SIGINT);
  }

 private:
  int at_;
};

// A signal anywhere in an exchange recovers (a control interface call ends with 2010); no reply queue is left.
TEST_F(CmdApiExchange, ASignalAnywhereInTheExchangeLeavesNoQueue) {
  // raiseAt: the message after which the signal comes; 0: from another thread.
  const struct { const char* when; int raiseAt; bool apiCall; } cases[] = {
      {"server queue just attached", 592, false},
      {"reply queue just created", 594, false},
      {"waiting for the reply", 0, false},
      {"waiting in a control interface call", 0, true},
  };
  for (const auto& c : cases) {
    FakeServer srv(tmp_.path(), "S1.KLP.KCAP");  // never answers
    auto r = klptest::inChild(tmp_.path(), [&] {
      std::string path = tmp_.path() + "S1.KLP.KCAP.IPC.CMD" + std::to_string(getpid());
      auto gone = [&] {  // a queue left behind is reported and removed
        HSVResID id;
        HSVHIPCQueue left;
        if (hsvIPCGetQueResID(path.c_str(), HSV_QUEUE_RESID_OPTION, &id) != ECF_OK ||
            left.attach(id) != ECF_OK)
          return true;
        return left.destroy(), false;
      };
      pthread_t caller = pthread_self();
      std::thread([&] {  // the request is put after both queues are registered for recovery
        if (c.raiseAt == 0 && klptest::waitFor([&] { return srv.hasRequest(); }, 10000) &&
            klptest::queueExists(path))
          pthread_kill(caller, SIGINT);
      }).detach();
      if (c.apiCall) {
        klpReleaseInfo rel{KLP_KIND_KCAP, 9, 1, 0};
        klpResultBlock res;
        static klpStatusFmt3 data;
        klpStatusRequest q{"S1", "KLP", {}, 0, &data, sizeof data, 0};
        return klpGetStatus(&rel, &q, &res) == 2010 && gone() ? 0 : 4;  // the call ends, not the caller
      }
      SignallingLogger logger(c.raiseAt);
      klpSetProcessLogger(&logger);
      klpThread* t = klpMainThread();
      klpThread::prologue(t);
      if (KLP_SET_RECOVERY_POINT(t->rcvyMgr) != 0) {
        recoveryMgr::erRecover(&t->rcvyMgr, t);
        return gone() ? 0 : 6;
      }
      cmdAPIFunc("S1.KLP.KCAP", 14, nullptr, nullptr, nullptr);
      return 5;
    });
    EXPECT_EQ(r.exitCode, 0) << c.when;
  }
}

// A server that keeps answering another request: the not-available report, the failed step; a bad name: the short one.
TEST_F(CmdApiExchange, DispatchPrintsTheNotAvailableReportWhenNoReplyComes) {
  useParms();
  cmd_->setParm(PARM_IDX_SERVER, "S1", PARM_SRC_COMMANDLINE);
  FakeServer srv(tmp_.path(), "S1.KLP.KCAP");
  srv.start(1, [&](const IpcMsgView& req) {
    for (int i = 0; i < 2000; ++i)
      if (srv.putRaw(req.header.senderPid, rawMsg(14, {}, 1, 0, 0))) return 0;
    return 1;  // the flood outlasted the call
  });
  std::string out = klptest::stdoutOf([] { EXPECT_EQ(klpCmdDispatch(1), KLP_API_NO_REPLY); });
  EXPECT_EQ(srv.finish(), 0);
  EXPECT_NE(out.find("  Schema name   (SCHEMA) = KLP\n  Not available (STATUS) = Not available\n"),
            std::string::npos) << out;
  EXPECT_TRUE(logged(log_, "*510 cmdAPIFunc 1 \\*\n589 klpkccmd 1 klpkccmd|1000|KLPCmdFunc"));
  EXPECT_FALSE(klptest::queueExists(replyPath("S1.KLP.KCAP")));
  cmd_->setParm(PARM_IDX_SERVER, std::string(129, 'N').c_str(), PARM_SRC_COMMANDLINE);  // cut, it would name another
  out = klptest::stdoutOf([] { EXPECT_EQ(klpCmdDispatch(1), KLP_API_BAD_NAME); });
  EXPECT_NE(out.find("(STATUS) = Unknown: the detailed status could not be obtained\n"), std::string::npos) << out;
}

}  // namespace
