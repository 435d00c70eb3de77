// The command-channel message: header bytes, requests and replies, checked
// decoding of received bytes, the in-process element, queue names, and
// multi-piece replies split, sent between processes and put together again.
#include "common/ipc/ipcmsg.h"

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "common/platform/hsv.h"
#include "common/util/klprc.h"
#include "tests/testing/klptest.h"

namespace {

int32_t wordAt(const void* base, size_t offset) {
  int32_t v;
  memcpy(&v, static_cast<const char*>(base) + offset, 4);
  return v;
}

// The nine header words after the eye-catcher.
std::vector<int32_t> headerWords(const void* msg) {
  std::vector<int32_t> w;
  for (size_t off = 8; off < IPC_HEADER_SIZE; off += 4) w.push_back(wordAt(msg, off));
  return w;
}

// Raw bytes of a message with the given header words and payload.
std::vector<char> rawMsg(int32_t length, const std::string& payload, int32_t version = 1,
                         int32_t pieceCount = 1, int32_t pieceNo = 0, int32_t total = 0,
                         int32_t func = IPC_FUNC_STATUS, int32_t pid = 4711) {
  std::vector<char> b(IPC_HEADER_SIZE + payload.size(), 0);
  memcpy(b.data(), "IPC:", 4);
  int32_t words[9] = {version, length, func, 0, pid, 0, pieceCount, pieceNo, total};
  memcpy(b.data() + 8, words, sizeof words);
  memcpy(b.data() + IPC_HEADER_SIZE, payload.data(), payload.size());
  return b;
}

std::string pattern(size_t n) {
  std::string s(n, '\0');
  for (size_t i = 0; i < n; ++i) s[i] = static_cast<char>('a' + (i * 7 + i / 4052) % 26);
  return s;
}

// Builds a reply with the payload and cuts it into pieces.
std::vector<std::vector<char>> split(const std::string& payload) {
  IpcMsg* reply = nullptr;
  EXPECT_EQ(0, createReplyMsg(&reply, IPC_HEADER_SIZE + payload.size(), 61, 4242));
  memcpy(reply->payload(), payload.data(), payload.size());
  std::vector<std::vector<char>> pieces;
  for (int32_t k = 1; k <= ipcPieceCount(payload.size()); ++k) {
    std::vector<char> piece(IPC_MAX_MSG_SIZE);
    size_t len = 0;
    EXPECT_EQ(0, ipcBuildPiece(reply, k, piece.data(), piece.size(), &len));
    piece.resize(len);
    pieces.push_back(piece);
  }
  freeIpcMsg(reply);
  return pieces;
}

int addRaw(IpcGather& g, const std::vector<char>& raw, int32_t* left) {
  IpcMsgView v;
  int rc = ipcDecodeMsg(raw.data(), raw.size(), &v);
  return rc != 0 ? rc : g.add(v, left);
}

void setWord(std::vector<char>& raw, size_t offset, int32_t v) { memcpy(raw.data() + offset, &v, 4); }

// A queue of its own under dir, for one test.
struct OwnQueue {
  std::string path;
  HSVResID id;
  HSVHIPCQueue q;
  explicit OwnQueue(const std::string& p) : path(p) {
    EXPECT_EQ(ECF_OK, hsvIPCGetQueResID(path.c_str(), HSV_QUEUE_RESID_OPTION, &id));
    EXPECT_EQ(ECF_OK, q.create(id, IPC_MAX_MSG_SIZE, HSV_CREATE_OPTION));
  }
  ~OwnQueue() {
    EXPECT_EQ(ECF_OK, q.destroy());
    EXPECT_FALSE(klptest::queueExists(path));
  }
};

}  // namespace

TEST(IpcMsgLayout, RequestAndReplyHeaderBytes) {
  IpcMsg* req = nullptr;
  ASSERT_EQ(0, createRequestMsg(&req, IPC_FUNC_CHGPARMS, 12, "ab"));
  req->reserved = 99;
  stampIpcMsg(req);
  const char* b = reinterpret_cast<const char*>(req);
  EXPECT_EQ(0, memcmp(b, "IPC:\0\0\0\0", 8));
  // Header, two characters and the NUL; requests carry no piece count.
  EXPECT_EQ((std::vector<int32_t>{1, 47, 20, 12, hsvProcessID(), 0, 0, 0, 0}), headerWords(b));
  EXPECT_EQ(0, memcmp(b + 44, "ab", 3));
  freeIpcMsg(req);

  ASSERT_EQ(0, createRequestMsg(&req, IPC_FUNC_STOP, 0, nullptr));
  EXPECT_EQ(44, req->msgLength);
  freeIpcMsg(req);
  EXPECT_EQ(KLP_RC_TOO_LONG,
            createRequestMsg(&req, IPC_FUNC_REINITQ, 0, std::string(4052, 'q').c_str()));
  EXPECT_EQ(nullptr, req);
  ASSERT_EQ(0, createRequestMsg(&req, IPC_FUNC_REINITQ, 0, std::string(4051, 'q').c_str()));
  EXPECT_EQ(4096, req->msgLength);
  freeIpcMsg(req);

  IpcMsg* reply = nullptr;
  ASSERT_EQ(0, createReplyMsg(&reply, 60, IPC_FUNC_STATUS_SIZE, 321));
  EXPECT_EQ(0, memcmp(reply, "IPC:\0\0\0\0", 8));
  EXPECT_EQ((std::vector<int32_t>{1, 60, 59, 0, 321, 0, 1, 0, 0}), headerWords(reply));
  EXPECT_EQ(std::string(16, '\0'), std::string(reply->payload(), 16));
  freeIpcMsg(reply);
  EXPECT_EQ(KLP_RC_BAD_PARM, createReplyMsg(&reply, 43, 14, 1));
  EXPECT_EQ(nullptr, reply);
}

TEST(IpcMsgDecode, RefusesWhatCannotBeTrusted) {
  IpcMsgView v;
  auto good = rawMsg(47, std::string("ab\0", 3));
  ASSERT_EQ(0, ipcDecodeMsg(good.data(), good.size(), &v));
  EXPECT_EQ(3u, v.payloadLen);
  EXPECT_EQ(good.data() + 44, v.payload);
  EXPECT_EQ(4711, v.header.senderPid);

  EXPECT_EQ(KLP_RC_GET_FAILED, ipcDecodeMsg(good.data(), 43, &v));  // shorter than a header
  EXPECT_EQ(KLP_RC_GET_FAILED, ipcDecodeMsg(nullptr, 0, &v));
  auto v2 = rawMsg(47, "abc", 2);
  EXPECT_EQ(KLP_RC_BAD_VERSION, ipcDecodeMsg(v2.data(), v2.size(), &v));
  EXPECT_EQ(2, v.header.msgVersion);
  auto eye = good;
  eye[0] = 'X';
  EXPECT_EQ(KLP_RC_GET_FAILED, ipcDecodeMsg(eye.data(), eye.size(), &v));
  // msgLength claiming more, less or nonsense than was received.
  for (int32_t claimed : {48, 46, 4096, 0, 43, -1, INT32_MAX}) {
    auto bad = rawMsg(claimed, "abc");
    EXPECT_EQ(KLP_RC_GET_FAILED, ipcDecodeMsg(bad.data(), bad.size(), &v)) << claimed;
    EXPECT_EQ(0u, v.payloadLen);
  }
  // Unknown codes pass: the engine answers them.
  auto odd = rawMsg(44, "", 1, 0, 0, 0, 77);
  EXPECT_EQ(0, ipcDecodeMsg(odd.data(), odd.size(), &v));
  EXPECT_EQ(nullptr, v.payload);
}

TEST(IpcMsgDecode, PayloadTextIsBoundedByPayloadAndDestination) {
  struct Case {
    std::string payload;
    size_t room;
    size_t len;
    const char* text;
  } cases[] = {{"abcdef", 16, 6, "abcdef"},
               {"abcdef", 4, 3, "abc"},  // no NUL in the payload
               {std::string("ab\0cd", 5), 16, 2, "ab"},
               {"", 16, 0, ""}};
  for (const Case& c : cases) {
    auto raw = rawMsg(static_cast<int32_t>(44 + c.payload.size()), c.payload);
    IpcMsgView v;
    ASSERT_EQ(0, ipcDecodeMsg(raw.data(), raw.size(), &v));
    char dst[16];
    EXPECT_EQ(c.len, ipcPayloadText(v, dst, c.room)) << c.text;
    EXPECT_STREQ(c.text, dst);
  }
}

TEST(MsgQeElement, BuiltFromARequestAndCutToTheField) {
  auto raw = rawMsg(49, std::string("ab\0cd", 5), 1, 0, 0, 0, IPC_FUNC_CHGPARMS, 4711);
  setWord(raw, 20, 9);
  IpcMsgView v;
  MsgQe* qe = nullptr;
  ASSERT_EQ(0, ipcDecodeMsg(raw.data(), raw.size(), &v));
  ASSERT_EQ(0, createMsgQe(&qe, v));
  EXPECT_STREQ("ITC:", qe->ole.eyeCatcher);
  EXPECT_EQ(64u, qe->ole.size);
  EXPECT_EQ(qe, qe->ole.object);
  EXPECT_EQ(nullptr, qe->ole.oleAnchor);
  EXPECT_EQ(20, qe->QeFunc);
  EXPECT_EQ(9, qe->QeSubFunc);
  EXPECT_EQ(0, qe->QeSubFuncInfo);
  EXPECT_EQ(4711, qe->QeResponseId);
  // With a requester the payload bytes come over as they are.
  EXPECT_EQ(0, memcmp(qe->QeString, "ab\0cd\0", 6));
  EXPECT_EQ(0u, qe->replyTag);
  setMsgQeReplyTag(qe, 0x1122334455667788ull);
  EXPECT_EQ(0x1122334455667788ull, qe->replyTag);
  deleteMsgQe(qe);
  // Without a requester only the text up to its NUL.
  setWord(raw, 24, 0);
  ASSERT_EQ(0, ipcDecodeMsg(raw.data(), raw.size(), &v));
  ASSERT_EQ(0, createMsgQe(&qe, v));
  EXPECT_EQ(0, memcmp(qe->QeString, "ab\0\0\0", 5));
  deleteMsgQe(qe);

  for (int32_t pid : {4711, 0}) {
    auto big = rawMsg(4096, std::string(4052, 'x'), 1, 0, 0, 0, IPC_FUNC_REINITQ, pid);
    ASSERT_EQ(0, ipcDecodeMsg(big.data(), big.size(), &v));
    ASSERT_EQ(0, createMsgQe(&qe, v));
    EXPECT_EQ(1039u, strlen(qe->QeString)) << pid;
    EXPECT_EQ(0u, qe->replyTag) << "the field after the text was overwritten";
    deleteMsgQe(qe);
  }
}

TEST(MsgQeElement, StopElementAndItsPrint) {
  MsgQe* stop = createMsgQeFunc(IPC_FUNC_STOP);
  ASSERT_NE(nullptr, stop);
  EXPECT_EQ(14, stop->QeFunc);
  EXPECT_EQ(0, stop->QeResponseId);
  EXPECT_STREQ("", stop->QeString);
  testing::internal::CaptureStdout();
  printMsgQe(stop);
  std::string out = testing::internal::GetCapturedStdout();
  char addr[32];
  snprintf(addr, sizeof addr, "%016llX", static_cast<unsigned long long>(reinterpret_cast<uintptr_t>(stop)));
  EXPECT_EQ(0u, out.find(std::string("MsgQe:print entered w/ QE ") + addr)) << out;
  EXPECT_NE(std::string::npos, out.find(" EyeCatcher=ITC:\n Size=64\n")) << out;
  EXPECT_NE(std::string::npos, out.find(" QeFunc=14\n")) << out;
  deleteMsgQe(stop);
}

TEST(QueueNames, PathsResIdTextAndProgramWords) {
  char path[64];
  ASSERT_EQ(0, ipcServerQueuePath(path, sizeof path, "/tmp/", "S1.A.KCAP"));
  EXPECT_STREQ("/tmp/S1.A.KCAP.IPC", path);
  ASSERT_EQ(0, ipcReplyQueuePath(path, sizeof path, "/tmp/", "S1.A.KCAP", 4711));
  EXPECT_STREQ("/tmp/S1.A.KCAP.IPC.CMD4711", path);
  ASSERT_EQ(0, ipcReplyQueuePath(path, sizeof path, "/d/", nullptr, 5));
  EXPECT_STREQ("/d/.IPC.CMD5", path);
  EXPECT_EQ(KLP_RC_TOO_LONG, ipcReplyQueuePath(path, 26, "/tmp/", "S1.A.KCAP", 4711));
  EXPECT_STREQ("", path);
  EXPECT_EQ(0, ipcReplyQueuePath(path, 27, "/tmp/", "S1.A.KCAP", 4711));

  char* text = ipcNewResIDText(nullptr);
  EXPECT_STREQ("UNKNOWN", text);
  free(text);
  HSVResID id;
  ASSERT_EQ(ECF_OK, hsvIPCGetQueResID("/tmp/S1.A.KCAP.IPC", HSV_QUEUE_RESID_OPTION, &id));
  text = ipcNewResIDText(&id);
  EXPECT_EQ("(" + std::string(id.part1) + ", " + id.part2 + ", " + id.part3 + ")", text);
  free(text);

  EXPECT_STREQ("K Capture", ipcProgramWord("S1.A.KCAP"));
  EXPECT_STREQ("Monitor Commands", ipcProgramCmdWord("S1.A.MON"));
  for (const char* unknown : {"S1.A.XYZ", "KCAP", "S1.A.kcap"}) {
    EXPECT_STREQ("*", ipcProgramWord(unknown)) << unknown;
    EXPECT_STREQ("*", ipcProgramCmdWord(unknown)) << unknown;
  }
}

TEST(Pieces, SplitAtTheMessageBound) {
  auto one = split(pattern(4052));
  ASSERT_EQ(1u, one.size());
  EXPECT_EQ(4096u, one[0].size());
  EXPECT_EQ(1, wordAt(one[0].data(), 32));

  auto two = split(pattern(4053));
  ASSERT_EQ(2u, two.size());
  EXPECT_EQ((std::vector<int32_t>{1, 4096, 61, 0, 4242, 0, 2, 1, 4053}), headerWords(two[0].data()));
  EXPECT_EQ((std::vector<int32_t>{1, 45, 61, 0, 4242, 0, 2, 2, 4053}), headerWords(two[1].data()));
  EXPECT_EQ(45u, two[1].size());
  EXPECT_EQ(pattern(4053).back(), two[1][44]);

  IpcMsg* reply = nullptr;
  ASSERT_EQ(0, createReplyMsg(&reply, 44 + 5000, 61, 1));
  char small[100];
  size_t len = 1;
  EXPECT_EQ(KLP_RC_BAD_PARM, ipcBuildPiece(reply, 3, small, sizeof small, &len));
  EXPECT_EQ(KLP_RC_BAD_PARM, ipcBuildPiece(reply, 1, small, sizeof small, &len));  // too small
  EXPECT_EQ(0u, len);
  freeIpcMsg(reply);
}

TEST(Pieces, ReassemblyRoundTripAndAppendedReplies) {
  for (size_t n : {size_t(0), size_t(1), size_t(4052), size_t(4053), size_t(3 * 4052), size_t(20000)}) {
    std::string payload = pattern(n);
    auto pieces = split(payload);
    IpcGather g;
    int32_t left = -1;
    for (size_t k = 0; k < pieces.size(); ++k) {
      ASSERT_EQ(0, addRaw(g, pieces[k], &left)) << n << " piece " << k;
      EXPECT_EQ(static_cast<int32_t>(pieces.size() - k - 1), left);
    }
    char* buf = g.release();
    ASSERT_NE(nullptr, buf);
    EXPECT_EQ(4242, wordAt(buf, 0));
    EXPECT_EQ(static_cast<int32_t>(n), wordAt(buf, 4));
    EXPECT_EQ(payload, std::string(buf + 8, n));
    EXPECT_EQ('\0', buf[8 + n]);
    free(buf);
  }

  // CHGPARMS with two changed parameters: two single replies, one buffer.
  IpcGather g;
  int32_t left = -1;
  ASSERT_EQ(0, addRaw(g, rawMsg(47, std::string("ab\0", 3), 1, 1, 0, 0, 20, 100), &left));
  EXPECT_EQ(0, left);
  ASSERT_EQ(0, addRaw(g, rawMsg(48, std::string("cde\0", 4), 1, 1, 0, 0, 20, 200), &left));
  char* buf = g.release();
  ASSERT_NE(nullptr, buf);
  EXPECT_EQ(100, wordAt(buf, 0));  // the first reply's sender
  EXPECT_EQ(7, wordAt(buf, 4));
  EXPECT_EQ(0, memcmp(buf + 8, "ab\0cde\0", 7));
  free(buf);
  IpcGather none;
  EXPECT_EQ(nullptr, none.release());
}

TEST(Pieces, CorruptedPieceHeadersFailCleanly) {
  auto pieces = split(pattern(3 * 4052 + 10));
  ASSERT_EQ(4u, pieces.size());
  struct Damage {
    const char* what;
    size_t piece;   // which piece is damaged
    size_t offset;  // header word
    int32_t value;
    size_t offset2 = 0;  // a second word, when not 0
    int32_t value2 = 0;
  };
  const Damage cases[] = {
      {"first piece not number 1", 0, 36, 2},
      {"piece number skipped", 1, 36, 3},
      {"piece number repeated", 2, 36, 2},
      {"piece number negative", 1, 36, -1},
      {"count changes midway", 2, 32, 5},
      {"code changes midway", 1, 16, IPC_FUNC_STATUS},
      {"total changes midway", 1, 40, 3 * 4052 + 11},
      {"total beyond the count", 0, 40, 5 * 4052},
      {"total below the count", 0, 40, 3 * 4052},
      {"negative total", 0, 40, -5},
      {"count beyond the total", 0, 32, INT32_MAX},
      // Consistent with each other but far beyond any reply: refused before
      // anything is allocated for it.
      {"huge count and total", 0, 32, 529982, 40, INT32_MAX},
      {"negative count", 0, 32, -2},
  };
  for (const Damage& d : cases) {
    IpcGather g;
    int32_t left = 0;
    int rc = 0;
    for (size_t k = 0; k < pieces.size() && rc == 0; ++k) {
      auto raw = pieces[k];
      if (k == d.piece) setWord(raw, d.offset, d.value);
      if (k == d.piece && d.offset2) setWord(raw, d.offset2, d.value2);
      rc = addRaw(g, raw, &left);
    }
    EXPECT_EQ(KLP_RC_GET_FAILED, rc) << d.what;
    EXPECT_EQ(nullptr, g.release()) << d.what;
    // A spoiled gather takes nothing more.
    EXPECT_EQ(KLP_RC_GET_FAILED, addRaw(g, pieces[0], &left)) << d.what;
  }

  // Pieces whose own length disagrees with the count and total.
  auto shortPiece = pieces[1];
  shortPiece.resize(shortPiece.size() - 1);
  setWord(shortPiece, 12, static_cast<int32_t>(shortPiece.size()));
  auto longLast = rawMsg(44 + 100, std::string(100, 'z'), 1, 4, 4, 3 * 4052 + 10);
  for (auto [good, bad] : {std::pair{1, shortPiece}, {3, longLast}}) {
    IpcGather g;
    int32_t left = 0;
    for (int k = 0; k < good; ++k) ASSERT_EQ(0, addRaw(g, pieces[k], &left));
    EXPECT_EQ(4 - good, left);
    EXPECT_EQ(KLP_RC_GET_FAILED, addRaw(g, bad, &left)) << good;
  }
  // A reply that ends early leaves pieces outstanding; it is not complete.
  IpcGather early;
  int32_t left = 0;
  ASSERT_EQ(0, addRaw(early, pieces[0], &left));
  EXPECT_EQ(3, early.outstanding());
}

TEST(Pieces, ATotalBeyondWhatItsCodeCanNeedIsRefusedAndRoomFollowsThePieces) {
  const struct {
    int32_t func;
    int32_t total;
    bool taken;
  } cases[] = {
      {IPC_FUNC_QRYPARMS, 69130, true},  // 64 slots of 1040-character values
      {IPC_FUNC_QRYPARMS, 69131, false},
      {IPC_FUNC_QRYPARMS, 64 * 1024 * 1024, false},
      {IPC_FUNC_STATUS, 1310733, false},  // more than 65536 thread records
      {IPC_FUNC_KCAP_DETAILS, 131133, false},
      {IPC_FUNC_KAPP_DETAILS, 50364448, true},  // 4096 entries
      {IPC_FUNC_KAPP_DETAILS, 50364449, false},
      {IPC_FUNC_CHGPARMS, 4053, false},  // the echo of one request
      {99, 4053, false},
  };
  for (const auto& c : cases) {
    int32_t count = (c.total + 4051) / 4052;
    IpcGather g;
    int32_t left = 0;
    auto first = rawMsg(4096, pattern(4052), 1, count, 1, c.total, c.func);
    EXPECT_EQ(c.taken ? 0 : KLP_RC_GET_FAILED, addRaw(g, first, &left)) << c.func << " " << c.total;
    EXPECT_EQ(c.taken ? count - 1 : 0, left) << c.func << " " << c.total;
    // A forged first piece costs what it brought, not what it claims.
    EXPECT_LE(g.reserved(), 4052u) << c.func << " " << c.total;
  }
}

TEST(Pieces, LongReplyTravelsBetweenProcesses) {
  klptest::TmpDir dir;
  char path[256];
  ASSERT_EQ(0, ipcReplyQueuePath(path, sizeof path, dir.path().c_str(), "S1.A.KAPP", hsvProcessID()));
  OwnQueue reply(path);
  const std::string payload = pattern(10000);
  pid_t pid = fork();
  if (pid == 0) {
    // The answering server: attaches to the requester's queue and sends
    // the reply in pieces.
    HSVHIPCQueue q;
    if (q.attach(reply.id) != ECF_OK) _exit(1);
    IpcMsg* msg = nullptr;
    if (createReplyMsg(&msg, 44 + payload.size(), 61, hsvProcessID()) != 0) _exit(2);
    memcpy(msg->payload(), payload.data(), payload.size());
    hsvRC prc;
    if (putIpcReply(&q, msg, -1, -1, &prc, "test") != 0) _exit(4);
    freeIpcMsg(msg);
    q.detach();
    _exit(0);
  }

  IpcGather g;
  int32_t left = 0;
  int got = 0;
  do {
    char buf[IPC_MAX_MSG_SIZE];
    size_t len = 0;
    ASSERT_EQ(ECF_OK, reply.q.get(buf, sizeof buf, &len, 20000));
    IpcMsgView v;
    ASSERT_EQ(0, ipcDecodeMsg(buf, len, &v));
    EXPECT_EQ(pid, v.header.senderPid);
    ASSERT_EQ(0, g.add(v, &left));
    ++got;
  } while (left > 0);
  int status = 0;
  ASSERT_EQ(pid, waitpid(pid, &status, 0));
  EXPECT_EQ(0, WEXITSTATUS(status));
  EXPECT_EQ(3, got);
  char* buf = g.release();
  ASSERT_NE(nullptr, buf);
  EXPECT_EQ(pid, wordAt(buf, 0));
  EXPECT_EQ(10000, wordAt(buf, 4));
  EXPECT_EQ(payload, std::string(buf + 8, 10000));
  free(buf);
}

TEST(Pieces, PutRefusesLengthsOutsideOneMessage) {
  klptest::TmpDir dir;
  OwnQueue own(dir.path() + "X.Y.KCAP.IPC");
  IpcMsg* msg = nullptr;
  ASSERT_EQ(0, createReplyMsg(&msg, 5000, 61, 1));
  hsvRC prc = 0;
  EXPECT_EQ(IPC_RC_PUT_FAILED, putIpcMsg(&own.q, msg, &prc));
  EXPECT_EQ(ECF_INVALID_ARGUMENT, prc);
  msg->msgLength = 20;
  EXPECT_EQ(IPC_RC_PUT_FAILED, putIpcMsg(&own.q, msg, &prc));
  EXPECT_FALSE(own.q.hasMessage());
  freeIpcMsg(msg);
}
