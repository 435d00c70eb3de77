// The command-channel message: header, checked decoding, element, queue names, pieces cut and gathered.
#include "common/ipc/ipcmsg.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "common/platform/hsv.h"
#include "common/util/klprc.h"
#include "tests/testing/klptest.h"

namespace {

using Words = std::vector<int32_t>;
using Bytes = std::vector<char>;
int32_t wordAt(const void* p, size_t off) { int32_t v; memcpy(&v, static_cast<const char*>(p) + off, 4); return v; }
void setWord(Bytes& raw, size_t offset, int32_t v) { memcpy(raw.data() + offset, &v, 4); }
// The nine header words after the eye-catcher.
Words headerWords(const void* msg) {
  Words w;
  for (size_t off = 8; off < IPC_HEADER_SIZE; off += 4) w.push_back(wordAt(msg, off));
  return w;
}
// Raw bytes of a message: the nine header words (version first), payload.
Bytes rawMsg(const Words& words, const std::string& payload) {
  Bytes b(IPC_HEADER_SIZE, 0);
  memcpy(b.data(), "IPC:", 4);
  memcpy(b.data() + 8, words.data(), 36);
  b.insert(b.end(), payload.begin(), payload.end());
  return b;
}
Bytes request(int32_t func, int32_t pid, const std::string& payload) {
  return rawMsg({1, static_cast<int32_t>(44 + payload.size()), func, 0, pid, 0, 0, 0, 0}, payload);
}
std::string pattern(size_t n) {  // differs from piece to piece
  std::string s(n, '\0');
  for (size_t i = 0; i < n; ++i) s[i] = static_cast<char>('a' + (i * 7 + i / 4052) % 26);
  return s;
}
// A reply of code 61 from process 4242 with the payload, cut into pieces.
std::vector<Bytes> split(const std::string& payload) {
  IpcMsg* reply = nullptr;
  EXPECT_EQ(0, createReplyMsg(&reply, IPC_HEADER_SIZE + payload.size(), 61, 4242));
  memcpy(reply->payload(), payload.data(), payload.size());
  std::vector<Bytes> pieces;
  for (int32_t k = 1; k <= ipcPieceCount(payload.size()); ++k) {
    Bytes piece(IPC_MAX_MSG_SIZE);
    size_t len = 0;
    EXPECT_EQ(0, ipcBuildPiece(reply, k, piece.data(), piece.size(), &len));
    pieces.emplace_back(piece.begin(), piece.begin() + len);
  }
  freeIpcMsg(reply);
  return pieces;
}
int addRaw(IpcGather& g, const Bytes& raw, int32_t* left) {
  IpcMsgView v;
  int rc = ipcDecodeMsg(raw.data(), raw.size(), &v);
  return rc != 0 ? rc : g.add(v, left);
}

}  // namespace

TEST(IpcMsg, HeaderBytesOfRequestsAndReplies) {
  IpcMsg* m = nullptr;
  ASSERT_EQ(0, createRequestMsg(&m, IPC_FUNC_CHGPARMS, 12, "ab"));
  m->reserved = 99;
  stampIpcMsg(m);
  // Header, two characters and the NUL; requests carry no piece count.
  EXPECT_EQ(std::string("IPC:\0\0\0\0", 8) + "ab", std::string(reinterpret_cast<char*>(m), 8) + m->payload());
  EXPECT_EQ((Words{1, 47, 20, 12, hsvProcessID(), 0, 0, 0, 0}), headerWords(m));
  freeIpcMsg(m);
  ASSERT_EQ(0, createRequestMsg(&m, IPC_FUNC_STOP, 0, nullptr));
  EXPECT_EQ(44, m->msgLength);
  freeIpcMsg(m);
  EXPECT_EQ(KLP_RC_TOO_LONG, createRequestMsg(&m, 23, 0, std::string(4052, 'q').c_str()));
  EXPECT_EQ(nullptr, m);
  ASSERT_EQ(0, createRequestMsg(&m, 23, 0, std::string(4051, 'q').c_str()));
  EXPECT_EQ(4096, m->msgLength);
  freeIpcMsg(m);
  ASSERT_EQ(0, createReplyMsg(&m, 60, IPC_FUNC_STATUS_SIZE, 321));
  EXPECT_EQ(std::string("IPC:\0\0\0\0", 8) + std::string(16, '\0'),
            std::string(reinterpret_cast<char*>(m), 8) + std::string(m->payload(), 16));
  EXPECT_EQ((Words{1, 60, 59, 0, 321, 0, 1, 0, 0}), headerWords(m));
  freeIpcMsg(m);
  EXPECT_EQ((Words{KLP_RC_BAD_PARM, KLP_RC_BAD_PARM}), (Words{createReplyMsg(&m, 43, 14, 1),
                                                              createRequestMsg(nullptr, 14, 0, nullptr)}));
  EXPECT_EQ(nullptr, m);
  std::string words;  // by code, in the order of the code table
  for (int32_t f = 9; f <= 26; ++f) words += std::string(ipcFuncWord(f)) + ",";
  EXPECT_EQ(",TRCSTART,,,,STOP,STATUS,,QRYPARMS,RESUME,SUSPEND,CHGPARMS,REINIT,PRUNE,REINITQ,STARTQ,STOPQ,,", words);
}

TEST(IpcMsg, DecodingRefusesWhatCannotBeTrusted) {
  IpcMsgView v;
  auto good = request(20, 4711, std::string("ab\0", 3));
  ASSERT_EQ(0, ipcDecodeMsg(good.data(), good.size(), &v));
  EXPECT_EQ(good.data() + 44, v.payload);
  EXPECT_EQ((Words{3, 4711}), (Words{static_cast<int32_t>(v.payloadLen), v.header.senderPid}));
  char text[3];
  EXPECT_EQ(2u, ipcPayloadText(v, text, sizeof text));
  EXPECT_EQ(KLP_RC_GET_FAILED, ipcDecodeMsg(good.data(), 43, &v));
  EXPECT_EQ((Words{KLP_RC_GET_FAILED, KLP_RC_GET_FAILED}), (Words{ipcDecodeMsg(nullptr, 0, &v),
                                                                  ipcDecodeMsg(nullptr, 100, &v)}));
  auto v2 = rawMsg({2, 47, 15, 0, 1, 0, 0, 0, 0}, "abc");
  EXPECT_EQ(KLP_RC_BAD_VERSION, ipcDecodeMsg(v2.data(), v2.size(), &v));
  EXPECT_EQ(2, v.header.msgVersion);
  good[3] = ';';
  EXPECT_EQ(KLP_RC_GET_FAILED, ipcDecodeMsg(good.data(), good.size(), &v));
  // msgLength claiming more, less or nonsense than was received.
  for (int32_t claimed : {48, 46, 4096, 0, 43, -1, INT32_MAX}) {
    auto bad = rawMsg({1, claimed, 15, 0, 1, 0, 0, 0, 0}, "abc");
    EXPECT_EQ(KLP_RC_GET_FAILED, ipcDecodeMsg(bad.data(), bad.size(), &v)) << claimed;
    EXPECT_EQ(0u, v.payloadLen);
  }
  auto odd = request(77, 1, "");  // unknown codes pass: the engine answers them
  EXPECT_EQ(0, ipcDecodeMsg(odd.data(), odd.size(), &v));
  EXPECT_EQ(nullptr, v.payload);
  EXPECT_EQ(0u, ipcPayloadText(v, text, sizeof text));
}

TEST(IpcMsg, MsgQeIsBuiltFromARequestCutToItsFieldAndPrinted) {
  auto raw = request(IPC_FUNC_CHGPARMS, 4711, std::string("ab\0cd", 5));
  setWord(raw, 20, 9);
  IpcMsgView v;
  MsgQe* qe = nullptr;
  for (int32_t pid : {4711, 0}) {
    setWord(raw, 24, pid);
    ASSERT_EQ(0, ipcDecodeMsg(raw.data(), raw.size(), &v));
    ASSERT_EQ(0, createMsgQe(&qe, v));
    EXPECT_EQ(std::string("ITC:\0\0\0", 8), std::string(qe->ole.eyeCatcher, 8));
    EXPECT_EQ((Words{64, 20, 9, 0, pid}), (Words{static_cast<int32_t>(qe->ole.size), qe->QeFunc, qe->QeSubFunc,
                                                  qe->QeSubFuncInfo, qe->QeResponseId}));
    EXPECT_EQ(qe, qe->ole.object);
    // With a requester the payload's bytes come as they are, without one the text up to its NUL.
    EXPECT_EQ(std::string(pid ? "ab\0cd\0" : "ab\0\0\0\0", 6), std::string(qe->QeString, 6));
    setMsgQeReplyTag(qe, 0x1122334455667788ull);
    EXPECT_EQ(0x1122334455667788ull, qe->replyTag);
    deleteMsgQe(qe);
    auto big = request(IPC_FUNC_REINITQ, pid, std::string(4052, 'x'));
    ASSERT_EQ(0, ipcDecodeMsg(big.data(), big.size(), &v));
    ASSERT_EQ(0, createMsgQe(&qe, v));
    EXPECT_EQ(1039u, strlen(qe->QeString)) << pid;
    EXPECT_EQ(0u, qe->replyTag) << "the field after the text was overwritten";
    deleteMsgQe(qe);
  }
  MsgQe* stop = createMsgQeFunc(IPC_FUNC_STOP);
  ASSERT_NE(nullptr, stop);
  std::string out = klptest::stdoutOf([&] { printMsgQe(stop); });
  char addr[32];
  snprintf(addr, sizeof addr, "%016llX", static_cast<unsigned long long>(reinterpret_cast<uintptr_t>(stop)));
  EXPECT_EQ("MsgQe:print entered w/ QE " + std::string(addr) + "\n QE Addr=" + addr +
                "\n EyeCatcher=ITC:\n Size=64\n prevElement=0000000000000000\n nextElement=0000000000000000\n"
                " QeFunc=14\n QeSubFunc=0\n QeSubFuncInfo=0\n QeResponseId=0\n QeString=\nMsgQe:print exit for QE " +
                addr + "\n", out);
  deleteMsgQe(stop);
}

TEST(IpcMsg, QueueNamesResIdTextAndProgramWords) {
  char path[64];
  ASSERT_EQ(0, ipcServerQueuePath(path, sizeof path, "/tmp/", "S1.A.KCAP"));
  EXPECT_STREQ("/tmp/S1.A.KCAP.IPC", path);
  EXPECT_EQ(KLP_RC_TOO_LONG, ipcServerQueuePath(path, 18, "/tmp/", "S1.A.KCAP"));
  EXPECT_EQ((Words{KLP_RC_BAD_PARM, KLP_RC_TOO_LONG}), (Words{ipcServerQueuePath(path, 0, "/", "S"),
                                                              ipcServerQueuePath(path, 1, "/", "S")}));
  ASSERT_EQ(0, ipcReplyQueuePath(path, 27, "/tmp/", "S1.A.KCAP", 4711));
  EXPECT_STREQ("/tmp/S1.A.KCAP.IPC.CMD4711", path);
  EXPECT_EQ(KLP_RC_TOO_LONG, ipcReplyQueuePath(path, 26, "/tmp/", "S1.A.KCAP", 4711));
  EXPECT_STREQ("", path);
  ASSERT_EQ(0, ipcReplyQueuePath(path, sizeof path, "/d/", nullptr, 5));
  EXPECT_STREQ("/d/.IPC.CMD5", path);
  HSVResID id;
  ASSERT_EQ(ECF_OK, hsvIPCGetQueResID("/tmp/MYDB.KLP.KCAP.IPC", HSV_QUEUE_RESID_OPTION, &id));
  char *known = ipcNewResIDText(&id), *unknown = ipcNewResIDText(nullptr);
  EXPECT_STREQ("(mqueue, /klpq.0499de10088ac99c, 48)", known);  // the documented example
  EXPECT_STREQ("UNKNOWN", unknown);
  free(known), free(unknown);
  const char* words[][3] = {
      {"S.A.CAP", "Capture", "Capture Commands"},       {"S.A.APP", "Apply", "Apply Commands"},
      {"S.A.KCAP", "K Capture", "K Capture Commands"},  {"S.A.KAPP", "K Apply", "K Apply Commands"},
      {"S.A.MON", "Monitor", "Monitor Commands"},       {"S1.A.XYZ", "*", "*"},
      {"KCAP", "*", "*"},                               {"S1.A.kcap", "*", "*"}};
  for (const auto& w : words)
    EXPECT_EQ(std::string(w[1]) + "/" + w[2], std::string(ipcProgramWord(w[0])) + "/" + ipcProgramCmdWord(w[0]));
  std::string codes;  // the function codes a server answers
  for (int32_t f = 0; f < 70; ++f)
    if (ipcFuncKnown(f)) codes += std::to_string(f) + " ";
  EXPECT_EQ("10 14 15 16 17 18 19 20 21 22 23 24 25 59 60 61 62 ", codes);
}

TEST(IpcPieces, SplitAtTheMessageBoundAndGatheredAgain) {
  auto one = split(pattern(4052)), two = split(pattern(4053));
  ASSERT_EQ((Words{1, 2}), (Words{static_cast<int32_t>(one.size()), static_cast<int32_t>(two.size())}));
  EXPECT_EQ((Words{1, 4096, 61, 0, 4242, 0, 1, 0, 0}), headerWords(one[0].data()));
  EXPECT_EQ((Words{1, 4096, 61, 0, 4242, 0, 2, 1, 4053}), headerWords(two[0].data()));
  EXPECT_EQ((Words{1, 45, 61, 0, 4242, 0, 2, 2, 4053}), headerWords(two[1].data()));
  IpcMsg* reply = nullptr;
  ASSERT_EQ(0, createReplyMsg(&reply, 44 + 5000, 61, 1));
  char small[100];
  size_t len = 1;
  EXPECT_EQ(KLP_RC_BAD_PARM, ipcBuildPiece(reply, 3, small, sizeof small, &len));
  EXPECT_EQ(KLP_RC_BAD_PARM, ipcBuildPiece(reply, 1, small, sizeof small, &len));  // too small
  EXPECT_EQ(KLP_RC_BAD_PARM, ipcBuildPiece(nullptr, 0, small, sizeof small, &len));
  EXPECT_EQ(0u, len);
  freeIpcMsg(reply);
  for (size_t n : {size_t(0), size_t(4053), size_t(3 * 4052), size_t(20000)}) {
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
    EXPECT_EQ((Words{4242, static_cast<int32_t>(n)}), (Words{wordAt(buf, 0), wordAt(buf, 4)}));
    EXPECT_EQ(payload + '\0', std::string(buf + 8, n + 1));
    free(buf);
  }
  // CHGPARMS of two parameters: two single replies, one buffer headed by the first one's sender.
  IpcGather g;
  int32_t left = -1;
  ASSERT_EQ(0, addRaw(g, rawMsg({1, 47, 20, 0, 100, 0, 1, 0, 0}, std::string("ab\0", 3)), &left));
  EXPECT_EQ(0, left);
  ASSERT_EQ(0, addRaw(g, rawMsg({1, 48, 20, 0, 200, 0, 1, 0, 0}, std::string("cde\0", 4)), &left));
  char* buf = g.release();
  ASSERT_NE(nullptr, buf);
  EXPECT_EQ((Words{100, 7}), (Words{wordAt(buf, 0), wordAt(buf, 4)}));
  EXPECT_EQ(std::string("ab\0cde\0", 7), std::string(buf + 8, 7));
  free(buf);
  EXPECT_EQ(nullptr, IpcGather().release());
}

TEST(IpcPieces, DamagedPieceHeadersSpoilTheGather) {
  auto pieces = split(pattern(3 * 4052 + 10));
  ASSERT_EQ(4u, pieces.size());
  const struct {
    size_t piece, offset;  // which piece, which header word
    int32_t value;
    size_t offset2 = 0;  // a second word, when not 0
    int32_t value2 = 0;
    int grow = 0;  // bytes added to (or taken from) the piece, its length word to match
  } cases[] = {
      {0, 36, 2},                       // first piece not number 1
      {1, 36, 3},         {2, 36, 2},   // piece number skipped, repeated
      {2, 32, 5},         {1, 16, 15},  // count or code changes midway
      {1, 40, 3 * 4052 + 11},           // total changes midway
      {0, 40, 5 * 4052},  {0, 40, 3 * 4052}, {0, 40, -5},  // total beyond or below the count, negative
      {0, 32, -2},  {0, 32, 529982, 40, INT32_MAX},        // negative count; huge count and total
      {1, 0, 0, 0, 0, -1}, {3, 0, 0, 0, 0, 90},          // a piece shorter, the last one longer
  };
  for (const auto& d : cases) {
    IpcGather g;
    int32_t left = 0;
    int rc = 0;
    for (size_t k = 0; k < pieces.size() && rc == 0; ++k) {
      auto raw = pieces[k];
      if (k == d.piece && d.grow) raw.resize(raw.size() + d.grow, 'z'), setWord(raw, 12, int32_t(raw.size()));
      if (k == d.piece && d.offset) setWord(raw, d.offset, d.value);
      if (k == d.piece && d.offset2) setWord(raw, d.offset2, d.value2);
      rc = addRaw(g, raw, &left);
    }
    EXPECT_EQ(KLP_RC_GET_FAILED, rc) << d.piece << " " << d.offset << " " << d.value;
    EXPECT_EQ(nullptr, g.release());
    EXPECT_EQ(KLP_RC_GET_FAILED, addRaw(g, pieces[0], &left));  // a spoiled gather takes nothing more
  }
}

// A first piece claims only what its code can need; a forged one costs what it brought, not what it claims.
TEST(IpcPieces, ATotalBeyondWhatItsCodeCanNeedIsRefused) {
  const struct {
    int32_t func, total;
    bool taken;
  } cases[] = {
      {17, 69130, true},    {17, 69131, false},     // 64 slots of 1040-character values
      {15, 1310732, true},  {15, 1310733, false},   // 65536 thread records
      {60, 131132, true},   {60, 131133, false},    // what two 16-bit offsets reach
      {61, 50364448, true}, {61, 50364449, false},  // 4096 entries
      {20, 4053, false},                            // the echo of one request
  };
  for (const auto& c : cases) {
    int32_t count = (c.total + 4051) / 4052, left = 0;
    IpcGather g;
    auto first = rawMsg({1, 4096, c.func, 0, 1, 0, count, 1, c.total}, pattern(4052));
    EXPECT_EQ(c.taken ? 0 : KLP_RC_GET_FAILED, addRaw(g, first, &left)) << c.func << " " << c.total;
    EXPECT_EQ(c.taken ? count - 1 : 0, left) << c.func << " " << c.total;
    EXPECT_LE(g.reserved(), 4052u) << c.func << " " << c.total;
  }
}
