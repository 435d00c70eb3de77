// Command client and control interface: reply checking, status data
// conversion, and exchanges with a fake server in a forked process over the
// real platform queues.
#include "common/ipc/cmdapi.h"

#include <gtest/gtest.h>
#include <fcntl.h>
#include <mqueue.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstddef>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <memory>
#include <iterator>
#include <string>
#include <thread>
#include <vector>

#include "common/env/klpenv.h"
#include "common/ipc/ipcmsg.h"
#include "common/msg/klplog.h"
#include "common/msg/msglogger.h"
#include "common/parms/klpparm.h"
#include "common/thread/klpthread.h"
#include "common/thread/recoverymgr.h"
#include "common/util/klprc.h"
#include "include/klpapi.h"
#include "tests/testing/klptest.h"
#include "xqpub/kcapcmdparms.h"
#include "xqpub/xqpubparms.h"

// The public records keep their byte layout.
namespace layout {
using Rel = klpReleaseInfo;
using Req = klpStatusRequest;
using Thr = klpStatusThread;
using F2 = klpStatusFmt2;
using F3 = klpStatusFmt3;
using Rec = klpStatusFmt2Record;
static_assert(sizeof(Rel) == 12 && offsetof(Rel, version) == 4 && offsetof(Rel, modification) == 8);
static_assert(offsetof(Req, schema) == 129 && offsetof(Req, statusSize) == 260 &&
              offsetof(Req, buffer) == 264 && offsetof(Req, bufferSize) == 272 &&
              offsetof(Req, requiredSize) == 276);
static_assert(sizeof(klpResultBlock) == 1036 && offsetof(klpResultBlock, text) == 8);
static_assert(sizeof(klpStatusFmt1) == 8 && sizeof(Thr) == 24 && offsetof(Thr, kind) == 16 &&
              offsetof(Thr, state) == 20);
static_assert(sizeof(F3) == KLP_STATUS_FMT3_SIZE && offsetof(F3, logFile) == 8 &&
              offsetof(F3, activeSubs) == 1036 && offsetof(F3, currentLogTime) == 1040 &&
              offsetof(F3, allPublishedLsn) == 1067 && offsetof(F3, currentMemory) == 1132 &&
              offsetof(F3, sectionText) == 1136 && offsetof(F3, sectionA) == 2161 &&
              offsetof(F3, sectionB) == 2191);
static_assert(sizeof(F2) == 1048 && offsetof(F2, value8) == 8 && offsetof(F2, text) == 12 &&
              offsetof(F2, value1040) == 1040 && offsetof(F2, value1044) == 1044);
static_assert(sizeof(Rec) == 12272 && offsetof(Rec, value52) == 52 &&
              offsetof(Rec, block83) == 83 && offsetof(Rec, block148) == 148 &&
              offsetof(Rec, time213) == 213 && offsetof(Rec, value240) == 240 &&
              offsetof(Rec, value248) == 248 && offsetof(Rec, value264) == 264 &&
              offsetof(Rec, text268) == 268 && offsetof(Rec, text3269) == 3269 &&
              offsetof(Rec, text6270) == 6270 && offsetof(Rec, text9271) == 9271);
}  // namespace layout

namespace {

void put32(std::vector<char>& b, size_t off, int32_t v) { std::memcpy(b.data() + off, &v, 4); }
void put16(std::vector<char>& b, size_t off, uint16_t v) { std::memcpy(b.data() + off, &v, 2); }
void put64(std::vector<char>& b, size_t off, int64_t v) { std::memcpy(b.data() + off, &v, 8); }
int32_t get32(const char* p, size_t off) {
  int32_t v;
  std::memcpy(&v, p + off, 4);
  return v;
}
bool has(const char* text, const char* what) { return std::strstr(text, what) != nullptr; }

// A STATUS payload: three header words and one 20-byte record per thread,
// plus the spare slot the server sizes its reply with.
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

// ---------------------------------------------------------------------------
// Thread kinds and names
// ---------------------------------------------------------------------------

TEST(CmdApiNames, ThreadKindsFollowTheNameTable) {
  // Names are stored cut to 14 characters, so a full kind name longer than
  // that never arrives: its first 14 characters match, 13 do not.
  const std::pair<const char*, int32_t> cases[] = {
      {"AdminThread", 1},    {"HoldLThread", 5},          {"PruneThread", 7},
      {"WorkerThread", 8},   {"MonitorThread", 6},        {"LogRdrThread", 9},
      {"BRx0000A9", 4},      {"BRx0000B9", 3},            {"BR", 3},  // no eighth character
      {"Admin", 0},          {"Somebody", 0},             {"BehinderWorker", 2},
      {"BehinderWorke", 0},  {"BehinderWorkerThread", 2}, {"BehinderWorkeX", 0},
  };
  for (const auto& [name, kind] : cases) EXPECT_EQ(klpThreadKind(name), kind) << name;
}

TEST(CmdApiNames, ServerNameIsUpperCasedAndJoined) {
  char out[KLP_UNIQUE_NAME_SIZE];
  ASSERT_EQ(klpBuildServerName(KLP_KIND_KCAP, "mydb", "klp.", out, sizeof(out)), 0);
  EXPECT_STREQ(out, "MYDB.KLP.KCAP");
  ASSERT_EQ(klpBuildServerName(KLP_KIND_APP, "db1 junk", "qrs\0junk", out, sizeof(out)), 0);
  EXPECT_STREQ(out, "DB1.QRS.APP");
  EXPECT_EQ(klpBuildServerName(KLP_KIND_MON, " x", "s", out, sizeof(out)), KLP_API_NO_SERVER);
  EXPECT_EQ(klpBuildServerName(KLP_KIND_MON, "x", "", out, sizeof(out)), KLP_API_NO_SCHEMA);
  EXPECT_EQ(klpBuildServerName(6, "x", "s", out, sizeof(out)), KLP_API_BAD_KIND);
  // A 128-character name field without terminator is read to 128 only.
  char server[128], schema[128];
  std::memset(server, 'a', sizeof(server));
  std::memset(schema, 'b', sizeof(schema));
  EXPECT_EQ(klpBuildServerName(KLP_KIND_CAP, server, schema, out, sizeof(out)), KLP_API_BAD_NAME);
}

// ---------------------------------------------------------------------------
// Status data of format 1
// ---------------------------------------------------------------------------

TEST(CmdApiStatusFormat1, ThreadsIntoFittingAndShortBuffers) {
  auto p = statusPayload({{"AdminThread", 4}, {"BRx0000A9", 5}, {"BehinderWorker", 8}});
  std::vector<char> out(80, 0x55);
  int32_t required = 0;
  ASSERT_EQ(klpStatusFromThreads(p.data(), p.size(), out.data(), out.size(), &required), 0);
  EXPECT_EQ(required, 80);
  EXPECT_EQ(get32(out.data(), 0), 1);
  EXPECT_EQ(get32(out.data(), 4), 3);
  klpStatusThread t[3];
  std::memcpy(t, out.data() + 8, sizeof(t));
  EXPECT_STREQ(t[0].name, "AdminThread");
  EXPECT_EQ(t[0].kind, 1);
  EXPECT_EQ(t[0].state, 4);
  EXPECT_EQ(t[1].kind, 4);
  EXPECT_EQ(t[2].kind, 2);
  EXPECT_EQ(t[2].state, 8);

  // 56 bytes hold two records: filled, the rest refused with 1001.
  std::vector<char> small(56 + 8, 0x55);
  ASSERT_EQ(klpStatusFromThreads(p.data(), p.size(), small.data(), 56, &required),
            KLP_API_BUFFER_TOO_SMALL);
  EXPECT_EQ(required, 80);
  EXPECT_EQ(get32(small.data(), 4), 2);
  for (size_t i = 56; i < small.size(); ++i) ASSERT_EQ(small[i], 0x55) << "byte " << i;

  // No threads need 32 bytes.
  auto none = statusPayload({});
  ASSERT_EQ(klpStatusFromThreads(none.data(), none.size(), out.data(), 32, &required), 0);
  EXPECT_EQ(required, 32);
  EXPECT_EQ(get32(out.data(), 4), 0);
}

TEST(CmdApiStatusFormat1, LyingTruncatedAndUnterminatedPayloads) {
  std::vector<char> out(1000);
  int32_t required = 0;
  auto conv = [&](const std::vector<char>& p, size_t len, size_t outLen = 1000) {
    return klpStatusFromThreads(p.data(), len, out.data(), outLen, &required);
  };
  auto claims3 = statusPayload({{"AdminThread", 4}}, 3);
  EXPECT_EQ(conv(claims3, claims3.size()), KLP_API_BAD_REPLY);
  EXPECT_EQ(conv(claims3, 11), KLP_API_BAD_REPLY);
  auto negative = statusPayload({}, 0);
  put32(negative, 8, -1);
  EXPECT_EQ(conv(negative, negative.size()), KLP_API_BAD_REPLY);
  // Exactly the records and no spare slot is still a whole reply.
  EXPECT_EQ(conv(statusPayload({{"A", 1}, {"B", 2}}), 12 + 40), 0);

  // Nothing is printed from a lying reply.
  auto claims9 = statusPayload({{"AdminThread", 4}}, 9);
  klpMsgCapture cap{};
  EXPECT_EQ(printState(claims9.data(), claims9.size(), &cap), 817);
  EXPECT_EQ(cap.length, 0);

  // An unterminated name is cut to 15 characters.
  auto unterminated = statusPayload({{"", 4}});
  std::memset(unterminated.data() + 12, 'N', 16);
  ASSERT_EQ(conv(unterminated, unterminated.size(), 32), 0);
  EXPECT_EQ(std::string(out.data() + 8), std::string(15, 'N'));
}

// ---------------------------------------------------------------------------
// Status data of format 3
// ---------------------------------------------------------------------------

std::vector<char> kcapPayload() {
  std::vector<char> p(400, 0);
  put32(p, 12, 90061);
  put32(p, 20, 7);
  std::memcpy(p.data() + 24, "2024-01-02-03.04.05.123456", 26);
  const unsigned char lsn[8] = {0x00, 0x0a, 0xbc, 0xde, 0xf0, 0x12, 0x34, 0xff};
  std::memcpy(p.data() + 51, lsn, 8);
  put32(p, 64, 4096);
  // log file at 100
  put16(p, 16, 100);
  put16(p, 100, 12);
  std::memcpy(p.data() + 102, "/var/log/kcp", 12);
  // section at 200: fields A and B, then its text
  put16(p, 68, 200);
  std::memset(p.data() + 200, 'A', 30);
  std::memset(p.data() + 230, 'B', 30);
  put16(p, 260, 5);
  std::memcpy(p.data() + 262, "hello", 5);
  return p;
}

int fromKcap(const std::vector<char>& p, klpStatusFmt3* s, size_t len = 0) {
  int32_t required = 0;
  return klpStatusFromKcap(p.data(), len ? len : p.size(), reinterpret_cast<char*>(s),
                           sizeof(*s), &required);
}

// Fields come from their offsets; an offset or length that points outside
// the payload spoils the whole reply: nothing is filled, not even the
// fields that were inside.
TEST(CmdApiStatusFormat3, FieldsFromTheirOffsetsOrNothing) {
  const struct {
    const char* what;
    std::vector<std::pair<size_t, uint16_t>> words;  // 16-bit words changed
    size_t len;                                      // payload length, 0: all
    int rc;
    const char* logFile = "";
    const char* sectionText = "";
  } cases[] = {
      {"whole", {}, 0, 0, "/var/log/kcp", "hello"},
      {"no log file, no section", {{16, 0}, {68, 0}}, 0, 0},
      {"log file length word past the end", {{16, 399}}, 0, KLP_API_BAD_REPLY},
      {"log file text past the end", {{100, 60000}}, 0, KLP_API_BAD_REPLY},
      {"section fields past the end", {{68, 380}}, 0, KLP_API_BAD_REPLY},
      {"section text past the end", {{260, 400}}, 0, KLP_API_BAD_REPLY},
      {"fixed fields cut short", {}, 69, KLP_API_BAD_REPLY},
  };
  for (const auto& c : cases) {
    auto p = kcapPayload();
    for (const auto& [at, value] : c.words) put16(p, at, value);
    std::vector<char> out(2224, 0x55);
    int32_t required = 0;
    EXPECT_EQ(klpStatusFromKcap(p.data(), c.len ? c.len : p.size(), out.data(), out.size(),
                                &required), c.rc) << c.what;
    if (c.rc != 0) {
      EXPECT_EQ(out, std::vector<char>(2224, 0x55)) << c.what;
      continue;
    }
    EXPECT_EQ(required, 2224);
    klpStatusFmt3 s;
    std::memcpy(&s, out.data(), sizeof(s));
    EXPECT_EQ(s.format, 3);
    EXPECT_EQ(s.upTime, 90061);
    EXPECT_EQ(s.activeSubs, 7);
    EXPECT_STREQ(s.currentLogTime, "2024-01-02-03.04.05.123456");
    EXPECT_STREQ(s.allPublishedLsn, "000ABCDEF01234FF");
    EXPECT_EQ(s.currentMemory, 4096);
    EXPECT_STREQ(s.logFile, c.logFile) << c.what;
    EXPECT_STREQ(s.sectionText, c.sectionText) << c.what;
    EXPECT_EQ(std::string(s.sectionB, 30), std::string(30, *c.sectionText ? 'B' : '\0'));
  }

  // A long log file name is cut to its field; a buffer one byte short gets
  // nothing.
  std::vector<char> big(2000, 0);
  put16(big, 16, 100);
  put16(big, 100, 1500);
  std::memset(big.data() + 102, 'x', 1500);
  klpStatusFmt3 s;
  ASSERT_EQ(fromKcap(big, &s), 0);
  EXPECT_EQ(std::strlen(s.logFile), 1027u);
  auto p = kcapPayload();
  std::vector<char> out(2223, 0x55);
  int32_t required = 0;
  EXPECT_EQ(klpStatusFromKcap(p.data(), p.size(), out.data(), out.size(), &required),
            KLP_API_BUFFER_TOO_SMALL);
  EXPECT_EQ(required, 2224);
  EXPECT_EQ(out, std::vector<char>(2223, 0x55));
}

// ---------------------------------------------------------------------------
// Status data of format 2
// ---------------------------------------------------------------------------

// A KAPP detailed status of `records` entries, each with the fields that
// take more than a copy: a 16-bit value widened, a 64-bit one cut, a text
// without terminator; the header's text sits at the end.
std::vector<char> kappPayload(int records) {
  std::vector<char> p(32 + 12296 * static_cast<size_t>(records) + 64, 0);
  put32(p, 12, records);
  put16(p, 20, static_cast<uint16_t>(p.size() - 20));
  put16(p, p.size() - 20, 4);
  std::memcpy(p.data() + p.size() - 18, "QMGR", 4);
  for (int r = 0; r < records; ++r) {
    size_t b = 32 + 12296 * static_cast<size_t>(r);
    std::memset(p.data() + b, 'a' + r, 48);
    put16(p, b + 248, static_cast<uint16_t>(-5));
    put64(p, b + 256, 0x100000007LL);
    std::memset(p.data() + b + 3289, 'z', 3001);
    std::memcpy(p.data() + b + 9291, "fourth", 6);
  }
  return p;
}

TEST(CmdApiStatusFormat2, RecordsAreCopiedWidenedAndCut) {
  auto p = kappPayload(2);
  std::vector<char> out(1048 + 2 * 12272, 0x55);
  int32_t required = 0;
  ASSERT_EQ(klpStatusFromKapp(p.data(), p.size(), out.data(), out.size(), &required), 0);
  EXPECT_EQ(required, 13320 + 12272);
  klpStatusFmt2 h;
  std::memcpy(&h, out.data(), sizeof(h));
  EXPECT_EQ(h.count, 2);
  EXPECT_STREQ(h.text, "QMGR");
  auto r = std::make_unique<klpStatusFmt2Record>();
  std::memcpy(r.get(), out.data() + 1048 + 12272, sizeof(*r));
  EXPECT_EQ(std::string(r->ident, 48), std::string(48, 'b'));
  EXPECT_EQ(r->value248, -5);
  EXPECT_EQ(r->value252, 7);  // low 32 bits of 0x100000007
  EXPECT_EQ(std::strlen(r->text3269), 3000u);
  EXPECT_STREQ(r->text9271, "fourth");
}

TEST(CmdApiStatusFormat2, ShortBuffersAndLyingCounts) {
  auto p = kappPayload(2);
  std::vector<char> out(13320, 0x55);
  int32_t required = 0;
  // Room for one record: that one is filled and the call still succeeds.
  ASSERT_EQ(klpStatusFromKapp(p.data(), p.size(), out.data(), out.size(), &required), 0);
  EXPECT_EQ(get32(out.data(), 4), 1);
  // Below 13320 nothing is written.
  std::vector<char> tiny(13319, 0x55);
  ASSERT_EQ(klpStatusFromKapp(p.data(), p.size(), tiny.data(), tiny.size(), &required), 0);
  for (char c : tiny) ASSERT_EQ(c, 0x55);
  // More records claimed than carried, or a text beyond the payload.
  put32(p, 12, 3);
  EXPECT_EQ(klpStatusFromKapp(p.data(), p.size(), out.data(), out.size(), &required),
            KLP_API_BAD_REPLY);
  p = kappPayload(0);
  put16(p, 20, static_cast<uint16_t>(p.size() - 1));
  EXPECT_EQ(klpStatusFromKapp(p.data(), p.size(), out.data(), out.size(), &required),
            KLP_API_BAD_REPLY);
}

// ---------------------------------------------------------------------------
// Exchanges with a fake server in a child process
// ---------------------------------------------------------------------------

// A logger for the messages of the calls under test, and the main thread
// known to the recovery manager so that queue resources can be registered.
class CmdApiExchange : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    logger_ = new klptest::ProcessLogger;
    klpEnsureMainThread();
  }
  static void TearDownTestSuite() {
    delete logger_;
  }
  // The IPC directory is kept once read: start each test from its own.
  void SetUp() override { ASSERT_EQ(klpEnvClear(klpGetEnv()), 0); }
  void TearDown() override { klpEnvClear(klpGetEnv()); }

  std::string replyPath(const std::string& server) {
    return tmp_.path() + server + ".IPC.CMD" + std::to_string(getpid());
  }

  klptest::TmpDir tmp_;
  static klptest::ProcessLogger* logger_;
};
klptest::ProcessLogger* CmdApiExchange::logger_ = nullptr;

// Server side run in a forked child: owns the server queue (created by the
// parent before the fork, so the client finds it at once) and answers
// `requests` requests with `respond`, whose answers are or-ed into the exit
// code.
class FakeServer {
 public:
  FakeServer(const std::string& dir, const std::string& name) : dir_(dir), name_(name) {
    std::string path = dir + name + ".IPC";
    HSVResID id;
    EXPECT_EQ(hsvIPCGetQueResID(path.c_str(), HSV_QUEUE_RESID_OPTION, &id), ECF_OK);
    EXPECT_EQ(queue_.create(id, HSV_MAX_MSG_SIZE, HSV_CREATE_OPTION), ECF_OK);
  }
  ~FakeServer() {
    if (child_ > 0) {
      kill(child_, SIGKILL);
      waitpid(child_, nullptr, 0);
    }
    queue_.destroy();
  }

  void start(int requests, const std::function<int(const IpcMsgView&)>& respond) {
    fflush(stdout);
    child_ = fork();
    if (child_ != 0) return;
    // The reply sender names the reply queue by this process's prefix.
    std::snprintf(klpGetEnv()->appVersion.rel.uniqueName, KLP_UNIQUE_NAME_SIZE, "%s",
                  name_.c_str());
    // A forked child is a new OS thread: register it as the main thread.
    klpThread::prologue(klpMainThread());
    int code = 0;
    for (int i = 0; i < requests; ++i) {
      char buf[HSV_MAX_MSG_SIZE];
      size_t got = 0;
      if (queue_.get(buf, sizeof(buf), &got, 20000) != ECF_OK) _exit(90);
      IpcMsgView view;
      if (ipcDecodeMsg(buf, got, &view) != 0) _exit(91);
      code |= respond(view);
    }
    fflush(stdout);
    _exit(code);
  }

  // Waits for the child (its own gets are bounded); answers its exit code.
  int finish() {
    int status = 0;
    if (child_ <= 0 || waitpid(child_, &status, 0) != child_) return -1;
    child_ = -1;
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }

  bool hasRequest() { return queue_.hasMessage(); }

  // Puts raw bytes on the requester's reply queue.
  int putRaw(int32_t pid, const std::vector<char>& bytes) {
    char path[2048];
    ipcReplyQueuePath(path, sizeof(path), dir_.c_str(), name_.c_str(), pid);
    HSVResID id;
    HSVHIPCQueue q;
    if (hsvIPCGetQueResID(path, HSV_QUEUE_RESID_OPTION, &id) != ECF_OK) return 80;
    if (q.attach(id) != ECF_OK) return 81;
    int rc = q.put(bytes.data(), bytes.size()) == ECF_OK ? 0 : 82;
    q.detach();
    return rc;
  }

  // Answers through the library's reply sender.
  static int reply(const IpcMsgView& req, const std::vector<char>& payload) {
    IpcMsg* msg = nullptr;
    if (createReplyMsg(&msg, IPC_HEADER_SIZE + payload.size(), req.header.func, getpid()) != 0)
      return 70;
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

// A hand-made reply message: header fields as given, payload bytes.
std::vector<char> rawMsg(int32_t func, const std::vector<char>& payload, int32_t pieceCount,
                         int32_t pieceNo, int32_t total, int32_t version = 1) {
  std::vector<char> m(IPC_HEADER_SIZE + payload.size(), 0);
  std::memcpy(m.data(), "IPC:", 4);
  put32(m, 8, version);
  put32(m, 12, static_cast<int32_t>(m.size()));
  put32(m, 16, func);
  put32(m, 24, getpid());
  put32(m, 32, pieceCount);
  put32(m, 36, pieceNo);
  put32(m, 40, total);
  if (!payload.empty()) std::memcpy(m.data() + IPC_HEADER_SIZE, payload.data(), payload.size());
  return m;
}

// A status request naming server and schema, with `out` as its buffer.
klpStatusRequest statusRequest(const char* server, const char* schema,
                               std::vector<char>* out = nullptr) {
  klpStatusRequest req{};
  std::strcpy(req.serverName, server);
  std::strcpy(req.schema, schema);
  if (out != nullptr) {
    req.buffer = out->data();
    req.bufferSize = static_cast<int32_t>(out->size());
  }
  return req;
}

// Polls `done` every 10 ms for up to 10 s.
bool eventually(const std::function<bool()>& done) {
  for (int i = 0; i < 1000; ++i) {
    if (done()) return true;
    usleep(10000);
  }
  return false;
}

TEST_F(CmdApiExchange, StopAndTextCommandsAreAnsweredAndQueuesAreGone) {
  FakeServer srv(tmp_.path(), "S1.KLP.KCAP");
  srv.start(2, [](const IpcMsgView& req) {
    bool stop = req.header.func == 14 && req.payloadLen == 0 && req.header.msgLength == 44;
    // Request text travels with its terminator.
    bool text = req.header.func == 23 && req.payloadLen == 3 &&
                std::memcmp(req.payload, "Q1", 3) == 0;
    return stop || text ? FakeServer::reply(req, {}) : 60;
  });
  char* reply = nullptr;
  klpMsgCapture cap{};
  EXPECT_EQ(cmdAPIFunc("S1.KLP.KCAP", 14, nullptr, &reply, &cap), 0) << cap.text;
  ASSERT_NE(reply, nullptr);
  EXPECT_GT(get32(reply, 0), 0);
  EXPECT_EQ(get32(reply, 4), 0);
  std::free(reply);
  EXPECT_FALSE(klptest::queueExists(replyPath("S1.KLP.KCAP")));
  cap = klpMsgCapture{};
  EXPECT_EQ(cmdAPIFunc("S1.KLP.KCAP", 23, "Q1", nullptr, &cap), 0) << cap.text;
  EXPECT_EQ(srv.finish(), 0);
  // The reply of an ordinary command is reported with message 522.
  EXPECT_TRUE(has(cap.text, "KLP0522")) << cap.text;
}

// A queue with our reply queue's name, and a message in it, left over by an
// earlier process with the same id, is replaced; the status reply is printed
// thread by thread, unless it claims more threads than it carries.
TEST_F(CmdApiExchange, StatusReplyIsPrintedPerThreadUnlessItLies) {
  std::string stale = replyPath("S1.KLP.KCAP");
  HSVResID id;
  ASSERT_EQ(hsvIPCGetQueResID(stale.c_str(), HSV_QUEUE_RESID_OPTION, &id), ECF_OK);
  HSVHIPCQueue old;
  ASSERT_EQ(old.create(id, HSV_MAX_MSG_SIZE, HSV_CREATE_OPTION), ECF_OK);
  auto junk = rawMsg(15, statusPayload({{"OldThread", 1}}), 1, 0, 0);
  ASSERT_EQ(old.put(junk.data(), junk.size()), ECF_OK);
  old.detach();

  FakeServer srv(tmp_.path(), "S1.KLP.KCAP");
  bool lie = false;
  srv.start(2, [&](const IpcMsgView& req) {
    auto good = statusPayload({{"AdminThread", 4}, {"HoldLThread", 5}});
    int rc = FakeServer::reply(req, lie ? statusPayload({{"AdminThread", 4}}, 50) : good);
    lie = true;
    return rc;
  });
  klpMsgCapture cap{};
  EXPECT_EQ(cmdAPIFunc("S1.KLP.KCAP", 15, nullptr, nullptr, &cap), 0) << cap.text;
  for (const char* want : {"AdminThread", "is doing work", "is resting"})
    EXPECT_TRUE(has(cap.text, want)) << want << " in " << cap.text;
  EXPECT_FALSE(has(cap.text, "OldThread")) << cap.text;
  EXPECT_FALSE(klptest::queueExists(stale));

  // A lying reply fails instead of being read beyond its end.
  cap = klpMsgCapture{};
  EXPECT_EQ(cmdAPIFunc("S1.KLP.KCAP", 15, nullptr, nullptr, &cap), 817);
  EXPECT_EQ(srv.finish(), 0);
  EXPECT_FALSE(has(cap.text, "AdminThread")) << cap.text;
  EXPECT_TRUE(has(cap.text, "817")) << cap.text;
}

// Replies whose pieces disagree, cannot carry their total or have the wrong
// version are refused, and nothing is handed to the caller. A reply whose
// function code is not the request's is the late answer to an earlier call
// that gave up waiting: it is dropped and the wait goes on.
TEST_F(CmdApiExchange, BrokenRepliesAreRefusedAndLateOnesDropped) {
  std::vector<char> first(4052, 'a'), rest(100, 'b');
  const struct {
    int32_t func;
    std::vector<std::vector<char>> put;  // raw messages, then (rc 0) the answer
    int rc;
    std::vector<char> answer;
  } cases[] = {
      {60, {rawMsg(60, first, 2, 1, 4152), rawMsg(60, rest, 2, 3, 4152)}, 816, {}},
      {60, {rawMsg(60, first, 2, 1, 100000)}, 816, {}},  // two pieces cannot carry it
      {14, {rawMsg(14, {}, 1, 0, 0, 2)}, 825, {}},
      {60, {rawMsg(14, {}, 1, 0, 0)}, 0, kcapPayload()},
      {14, {rawMsg(15, statusPayload({{"OldThread", 1}}), 1, 0, 0)}, 0, {}},
      {15, {rawMsg(61, first, 2, 1, 4152), rawMsg(61, rest, 2, 2, 4152)}, 0,
       statusPayload({{"AdminThread", 4}})},
  };
  FakeServer srv(tmp_.path(), "S1.KLP.KCAP");
  size_t n = 0;
  srv.start(std::size(cases), [&](const IpcMsgView& req) {
    const auto& c = cases[n++];
    int rc = 0;
    for (const auto& m : c.put) rc |= srv.putRaw(req.header.senderPid, m);
    return c.rc == 0 ? rc | FakeServer::reply(req, c.answer) : rc;
  });
  for (const auto& c : cases) {
    char* reply = nullptr;
    klpMsgCapture cap{};
    ASSERT_EQ(cmdAPIFunc("S1.KLP.KCAP", c.func, nullptr, &reply, &cap), c.rc) << c.func;
    EXPECT_EQ(c.rc == 0, reply != nullptr);
    EXPECT_EQ(c.rc == 816, has(cap.text, "KLP0589")) << cap.text;
    if (reply) {
      EXPECT_EQ(std::vector<char>(reply + 8, reply + 8 + get32(reply, 4)), c.answer) << c.func;
      std::free(reply);
    }
    EXPECT_FALSE(klptest::queueExists(replyPath("S1.KLP.KCAP")));
  }
  EXPECT_EQ(srv.finish(), 0);
}

// Two threads of a process calling at once take turns, where the second
// would replace the first one's reply queue (named by the process id) and
// leave it waiting for nothing.
TEST_F(CmdApiExchange, TwoThreadsCallingAtOnceTakeTurns) {
  FakeServer srv(tmp_.path(), "S1.KLP.KCAP");
  bool first = true;
  srv.start(2, [&](const IpcMsgView& req) {
    // The first answer waits for a second request, for 2 s at most: calls
    // that overlapped have both put theirs by then.
    for (int i = 0; first && i < 200 && !srv.hasRequest(); ++i) usleep(10000);
    first = false;
    return FakeServer::reply(req, req.header.func == 60 ? kcapPayload() : std::vector<char>{});
  });
  int rc[2] = {-1, -1};
  int32_t len[2] = {-1, -1};
  auto call = [&](int i, int func) {
    char* reply = nullptr;
    klpMsgCapture cap{};
    rc[i] = cmdAPIFunc("S1.KLP.KCAP", func, nullptr, &reply, &cap);
    if (reply) len[i] = get32(reply, 4);
    std::free(reply);
  };
  std::thread other(call, 1, 14);
  call(0, 60);
  other.join();
  EXPECT_EQ(srv.finish(), 0);
  EXPECT_EQ(rc[0], 0);
  EXPECT_EQ(rc[1], 0);
  EXPECT_EQ(len[0], 400);
  EXPECT_EQ(len[1], 0);
}

// The collector asks each kind of server its own question and converts
// the answer; with no buffer it allocates one. A reply that does not hold
// what it claims is refused as a whole, with the message that says so in
// the result block.
TEST_F(CmdApiExchange, CollectorConvertsWholeRepliesOnly) {
  auto badOffset = kcapPayload();
  put16(badOffset, 16, 399);
  const struct {
    int32_t kind;
    const char* server;
    int32_t func;
    std::vector<char> payload;
    size_t bufferSize;  // 0: the collector allocates
    int rc;
    int32_t required;
    int16_t format;
  } cases[] = {
      {KLP_KIND_KAPP, "S1.KLP.KAPP", 61, kappPayload(2), 1048 + 2 * 12272, 0, 13320 + 12272, 2},
      {KLP_KIND_KCAP, "S1.KLP.KCAP", 60, kcapPayload(), 0, 0, 2224, 3},
      {KLP_KIND_CAP, "S1.KLP.CAP", 15, statusPayload({{"AdminThread", 4}}, 3), 200,
       KLP_API_BAD_REPLY, 0, 0},
      {KLP_KIND_KCAP, "S1.KLP.KCAP", 60, badOffset, 0, KLP_API_BAD_REPLY, 0, 0},
  };
  for (const auto& c : cases) {
    FakeServer srv(tmp_.path(), c.server);
    srv.start(1, [&](const IpcMsgView& req) {
      return req.header.func == c.func ? FakeServer::reply(req, c.payload) : 62;
    });
    klpReleaseInfo rel{c.kind, 9, 1, 0};
    std::vector<char> out(c.bufferSize);
    auto req = statusRequest("s1", "klp.", c.bufferSize ? &out : nullptr);
    klpResultBlock res{};
    klpMsgCapture cap{};
    EXPECT_EQ(klpCollectStatus(&rel, &req, &res, &cap), c.rc) << c.server;
    EXPECT_EQ(srv.finish(), 0);
    EXPECT_EQ(res.rc, c.rc);
    EXPECT_EQ(req.requiredSize, c.required);
    int16_t format = 0;
    if (req.buffer && c.rc == 0) std::memcpy(&format, req.buffer, sizeof(format));
    EXPECT_EQ(format, c.format) << c.server;
    EXPECT_EQ(has(res.text, "KLP0589") && has(res.text, "2017"), c.rc != 0) << res.text;
    if (c.bufferSize == 0) std::free(req.buffer);
  }
}

TEST_F(CmdApiExchange, ChangedParametersAreSentOneByOne) {
  ParmEntry cmdTable[KCAPCMD_PARM_COUNT];
  ParmEntry srvTable[XQPUB_PARM_COUNT];
  buildKCapCmdParmTable(cmdTable);
  buildXqpubParmTable(srvTable);
  int rc1 = 0, rc2 = 0;
  kCapCmdParmClass cmd(cmdTable, KCAPCMD_PARM_COUNT, &rc1);
  xqpubParms server(srvTable, XQPUB_PARM_COUNT, &rc2);
  ASSERT_EQ(rc1, 0);
  ASSERT_EQ(rc2, 0);
  cmd.setServerParms(&server);
  ASSERT_EQ(cmd.addChgParm(30, "1000"), 0);
  ASSERT_EQ(cmd.addChgParm(16, "200"), 0);
  ASSERT_EQ(cmd.addChgParm(XQPUB_ADMINQ, ""), 0);
  klpParmClass* before = klpGetCurrentParms();
  klpSetCurrentParms(&cmd);

  FakeServer srv(tmp_.path(), "S1.KLP.KCAP");
  srv.start(3, [](const IpcMsgView& req) {
    if (req.header.func != 20) return 64;
    // Every value travels with its NUL, an empty one too.
    if (req.payloadLen == 0 || req.payload[req.payloadLen - 1] != '\0') return 66;
    // The request is echoed back, its subFunc naming the parameter.
    return FakeServer::reply(req, std::vector<char>(req.payload, req.payload + req.payloadLen));
  });
  klpMsgCapture cap{};
  int rc = cmdAPIFunc("S1.KLP.KCAP", 20, nullptr, nullptr, &cap);
  klpSetCurrentParms(before);
  EXPECT_EQ(rc, 0) << cap.text;
  EXPECT_EQ(srv.finish(), 0);
  for (const char* want : {"COMMIT_INTERVAL", "SLEEP_INTERVAL", "ADMINQ", "1000", "200"})
    EXPECT_TRUE(has(cap.text, want)) << want << " in " << cap.text;
}

TEST_F(CmdApiExchange, ReplySenderCutsLongRepliesIntoPieces) {
  // Our own reply queue, named as the reply sender forms it with no prefix.
  char path[2048];
  ASSERT_EQ(ipcReplyQueuePath(path, sizeof(path), getEnvIPCDir(klpGetEnv()), nullptr, 4711), 0);
  HSVResID id;
  ASSERT_EQ(hsvIPCGetQueResID(path, HSV_QUEUE_RESID_OPTION, &id), ECF_OK);
  HSVHIPCQueue q;
  ASSERT_EQ(q.create(id, HSV_MAX_MSG_SIZE, HSV_CREATE_OPTION), ECF_OK);

  IpcMsg* msg = nullptr;
  ASSERT_EQ(createReplyMsg(&msg, IPC_HEADER_SIZE + 4053, 17, getpid()), 0);
  for (int i = 0; i < 4053; ++i) msg->payload()[i] = static_cast<char>(i % 251);
  EXPECT_EQ(KLPResponseFunc(4711, msg), 0);

  char buf[HSV_MAX_MSG_SIZE];
  size_t got = 0;
  IpcGather gather;
  int32_t left = -1;
  std::vector<size_t> sizes;
  while (left != 0 && q.get(buf, sizeof(buf), &got, 2000) == ECF_OK) {
    sizes.push_back(got);
    IpcMsgView v;
    ASSERT_EQ(ipcDecodeMsg(buf, got, &v), 0);
    EXPECT_EQ(v.header.pieceCount, 2);
    EXPECT_EQ(v.header.totalLength, 4053);
    ASSERT_EQ(gather.add(v, &left), 0);
  }
  ASSERT_EQ(sizes, (std::vector<size_t>{4096, 45}));
  char* all = gather.release();
  ASSERT_NE(all, nullptr);
  EXPECT_EQ(get32(all, 4), 4053);
  EXPECT_EQ(std::memcmp(all + 8, msg->payload(), 4053), 0);
  std::free(all);
  freeIpcMsg(msg);
  q.destroy();
}

// ---------------------------------------------------------------------------
// The control interface's checks
// ---------------------------------------------------------------------------

TEST_F(CmdApiExchange, ArgumentChecksComeInOrder) {
  klpResultBlock res;
  klpReleaseInfo rel{KLP_KIND_CAP, 9, 1, 0};
  auto req = statusRequest("S1", "KLP");

  EXPECT_EQ(klpStartProgram(), 0);
  EXPECT_EQ(klpStopProgram(1, "S", "K", 0, nullptr), 2001);
  EXPECT_EQ(klpStopProgram(0, "S", "K", 0, &res), 2006);
  EXPECT_EQ(res.rc, 2006);
  EXPECT_EQ(klpStopProgram(1, "", "K", -1, &res), 2007);
  EXPECT_EQ(klpStopProgram(1, "S", " ", -1, &res), 2008);
  EXPECT_EQ(klpStopProgram(1, "S", "K", -1, &res), 2005);

  EXPECT_EQ(klpGetStatusSize(&rel, &req, nullptr), 2001);
  std::memset(&res, 0x7f, sizeof(res));
  EXPECT_EQ(klpGetStatusSize(nullptr, &req, &res), 2001);
  EXPECT_STREQ(res.text, "klpReleaseInfo");
  EXPECT_EQ(klpGetStatusSize(&rel, nullptr, &res), 2001);
  EXPECT_STREQ(res.text, "klpGetStatusDataSize");
  klpReleaseInfo old{KLP_KIND_CAP, 9, 1, 1};
  EXPECT_EQ(klpGetStatusSize(&old, &req, &res), 2002);
  klpReleaseInfo bad{6, 9, 1, 0};
  EXPECT_EQ(klpGetStatusSize(&bad, &req, &res), 2006);
  klpReleaseInfo kcap{KLP_KIND_KCAP, 9, 1, 0};
  klpStatusRequest none{};  // no names: KCAP needs no server for its size
  EXPECT_EQ(klpGetStatusSize(&kcap, &none, &res), 0);
  EXPECT_EQ(none.statusSize, 2224);
  auto noSchema = statusRequest("S1", "");
  EXPECT_EQ(klpGetStatusSize(&rel, &noSchema, &res), 2008);

  EXPECT_EQ(klpGetStatus(nullptr, &req, &res), 2001);
  EXPECT_EQ(klpGetStatus(&rel, nullptr, &res), 2001);
  EXPECT_STREQ(res.text, "klpGetStatusData");
  EXPECT_EQ(klpGetStatus(&rel, &req, &res), 2003);
  char buf[64];
  req.buffer = buf;
  req.bufferSize = 0;
  EXPECT_EQ(klpGetStatus(&rel, &req, &res), 2004);
  req.bufferSize = sizeof(buf);
  EXPECT_EQ(klpGetStatus(&old, &req, &res), 2002);
  EXPECT_EQ(klpGetStatus(&bad, &req, &res), 2006);
  std::strcpy(req.serverName, " ");
  EXPECT_EQ(klpGetStatus(&rel, &req, &res), 2007);

  // A name cut to fit would address some other server.
  klpMsgCapture cap{};
  EXPECT_EQ(KLPMonFunc(std::string(220, 'S').c_str(), "KLP.MON", &cap), 2009);
  EXPECT_TRUE(has(cap.text, "KLP0589")) << cap.text;
}

// The size comes from the thread count behind the "klpSISize: " text; a
// reply without that text, or too short to carry the count, is refused.
TEST_F(CmdApiExchange, StatusSizeFromTheThreadCount) {
  auto sizeReply = [](const char* text, int32_t count, size_t len = 16) {
    std::vector<char> p(16, 0);
    std::memcpy(p.data(), text, 12);
    put32(p, 12, count);
    p.resize(len);
    return p;
  };
  const struct {
    std::vector<char> payload;
    int rc;
    int32_t size;
  } cases[] = {
      {sizeReply("klpSISize: ", 3), 0, 80},
      {sizeReply("klpSISize: ", 0), 0, 32},
      {sizeReply("klpSIsize: ", 3), KLP_API_BAD_REPLY, 0},
      {sizeReply("klpSISize: ", 3, 15), KLP_API_BAD_REPLY, 0},
      {sizeReply("klpSISize: ", -1), KLP_API_BAD_REPLY, 0},
  };
  FakeServer srv(tmp_.path(), "S1.KLP.MON");
  size_t n = 0;
  srv.start(std::size(cases), [&](const IpcMsgView& req) {
    return req.header.func == 59 ? FakeServer::reply(req, cases[n++].payload) : 65;
  });
  klpReleaseInfo rel{KLP_KIND_MON, 9, 1, 0};
  for (const auto& c : cases) {
    auto req = statusRequest("s1", "klp");
    klpResultBlock res{};
    EXPECT_EQ(klpGetStatusSize(&rel, &req, &res), c.rc) << res.text;
    EXPECT_EQ(req.statusSize, c.size);
    EXPECT_EQ(has(res.text, "KLP0589"), c.rc != 0) << res.text;
  }
  EXPECT_EQ(srv.finish(), 0);
}

// A server whose queue exists but that never answers: 16 polls, 15 pauses.
TEST_F(CmdApiExchange, SilentServerEndsWithNoReply) {
  FakeServer srv(tmp_.path(), "S1.KLP.KCAP");
  klpMsgCapture cap{};
  EXPECT_EQ(cmdAPIFunc("S1.KLP.KCAP", 14, nullptr, nullptr, &cap), 824);
  EXPECT_TRUE(has(cap.text, "KLP0510")) << cap.text;
  EXPECT_FALSE(klptest::queueExists(replyPath("S1.KLP.KCAP")));
}

// A peer that keeps answering some other request cannot hold the exchange
// past its budget: the call gives up while the flood still runs, and the
// flooder finds the reply queue gone.
TEST_F(CmdApiExchange, EndlessWrongAnswersEndWithNoReply) {
  FakeServer srv(tmp_.path(), "S1.KLP.KCAP");
  srv.start(1, [&](const IpcMsgView& req) {
    for (int i = 0; i < 2000; ++i)
      if (srv.putRaw(req.header.senderPid, rawMsg(15, {}, 1, 0, 0)) != 0) return 0;
    return 1;  // the call was still taking them
  });
  klpMsgCapture cap{};
  EXPECT_EQ(cmdAPIFunc("S1.KLP.KCAP", 14, nullptr, nullptr, &cap), 824);
  EXPECT_TRUE(has(cap.text, "KLP0510")) << cap.text;
  EXPECT_EQ(srv.finish(), 0);
}

// A server queue that is not private to us is refused at the first attempt:
// it will not become ours by waiting (retrying would take four pauses).
TEST_F(CmdApiExchange, AQueueOpenToOthersIsRefusedWithoutRetrying) {
  std::string path = tmp_.path() + "S1.KLP.KCAP.IPC";
  HSVResID id{};
  ASSERT_EQ(hsvIPCGetQueResID(path.c_str(), HSV_QUEUE_RESID_OPTION, &id), ECF_OK);
  mq_attr attr{};
  attr.mq_maxmsg = HSV_QUEUE_DEPTH;
  attr.mq_msgsize = HSV_MAX_MSG_SIZE;
  mqd_t raw = mq_open(id.posixName(), O_RDWR | O_CREAT | O_EXCL, 0600, &attr);
  ASSERT_NE(raw, static_cast<mqd_t>(-1));
  ASSERT_EQ(fchmod(raw, 0666), 0);
  HSVHIPCQueue q;
  char resId[64];
  hsvRC prc = 0;
  auto start = std::chrono::steady_clock::now();
  EXPECT_EQ(KLPAttachIPCQ(&q, resId, sizeof(resId), path.c_str(), &prc), 815);
  EXPECT_EQ(prc, ECF_NOT_OWNED);
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(4));
  mq_close(raw);
  mq_unlink(id.posixName());
}

// A logger that raises SIGINT once message `at` is composed: a signal that
// arrives right at that point of an exchange.
class SignallingLogger : public msgLoggerU {
 public:
  explicit SignallingLogger(int at) : msgLoggerU(10, 0), at_(at) {
    loadBuiltinMsgs(builtinMsgTable);
  }
  void composeKlpMsg(logMsg* record) override {
    msgLoggerU::composeKlpMsg(record);
    if (record->msgNumber == at_) raise(SIGINT);
  }

 private:
  int at_;
};

// A signal anywhere in an exchange returns to the recovery point, whose
// recovery resources undo the queues: no reply queue is left behind.
TEST_F(CmdApiExchange, ASignalAnywhereInTheExchangeLeavesNoQueue) {
  const struct {
    const char* when;
    int raiseAt;  // message after which the signal comes; 0: from outside
  } cases[] = {
      {"server queue just attached", 592},
      {"reply queue just created", 594},
      {"waiting for the reply", 0},
  };
  for (const auto& c : cases) {
    FakeServer srv(tmp_.path(), "S1.KLP.KCAP");  // never answers
    fflush(stdout);
    pid_t child = fork();
    if (child == 0) {
      SignallingLogger logger(c.raiseAt);
      klpSetProcessLogger(&logger);
      klpThread* t = klpMainThread();
      klpThread::prologue(t);
      if (KLP_SET_RECOVERY_POINT(t->rcvyMgr) != 0) {
        recoveryMgr::erRecover(&t->rcvyMgr, t);
        fflush(stdout);
        _exit(0);
      }
      cmdAPIFunc("S1.KLP.KCAP", 14, nullptr, nullptr, nullptr);
      _exit(5);
    }
    ASSERT_GT(child, 0);
    std::string path = tmp_.path() + "S1.KLP.KCAP.IPC.CMD" + std::to_string(child);
    if (c.raiseAt == 0) {
      // The request is put after both queues are registered for recovery.
      ASSERT_TRUE(eventually([&] { return srv.hasRequest(); }));
      EXPECT_TRUE(klptest::queueExists(path));
      kill(child, SIGINT);
    }
    int status = 0;
    bool ended = eventually([&] { return waitpid(child, &status, WNOHANG) == child; });
    if (!ended) {
      kill(child, SIGKILL);
      waitpid(child, &status, 0);
    }
    ASSERT_TRUE(ended) << c.when;
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << c.when;
    if (klptest::queueExists(path)) {
      ADD_FAILURE() << "reply queue left behind when the signal came with the " << c.when;
      HSVResID id;
      HSVHIPCQueue left;
      if (hsvIPCGetQueResID(path.c_str(), HSV_QUEUE_RESID_OPTION, &id) == ECF_OK &&
          left.attach(id) == ECF_OK)
        left.destroy();
    }
  }
}

}  // namespace
