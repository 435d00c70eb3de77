// The command-channel message, its pieces, queue names and the in-process
// command element.
#include "common/ipc/ipcmsg.h"

#include <chrono>
#include <cinttypes>
#include <cstdlib>
#include <cstring>
#include <new>

#include "common/env/klpenv.h"
#include "common/msg/klplog.h"
#include "common/parms/klpparm.h"
#include "common/util/klprc.h"

namespace {

void setEyeCatcher(IpcMsg* msg) {
  memset(msg->eyeCatcher, 0, sizeof msg->eyeCatcher);
  memcpy(msg->eyeCatcher, IPC_EYE_CATCHER, strlen(IPC_EYE_CATCHER));
}

IpcMsg* allocMsg(size_t size, const char* origin) {
  auto* msg = static_cast<IpcMsg*>(calloc(1, size));
  if (!msg) {
    char sizeText[24];
    snprintf(sizeText, sizeof sizeText, "%" PRIu64, static_cast<uint64_t>(size));
    logKlpMsg(543, origin, KLP_DEST_SEVERITY, sizeText, nullptr, 1, "IPC message");
  }
  return msg;
}

int pathInto(char* out, size_t outLen, int n) {
  if (n < 0 || static_cast<size_t>(n) >= outLen) {
    out[0] = '\0';
    return KLP_RC_TOO_LONG;
  }
  return KLP_OK;
}

// The last dot-separated part of a server name; null when there is no dot.
const char* lastPart(const char* serverName) {
  if (!serverName) return nullptr;
  const char* dot = strrchr(serverName, '.');
  return dot ? dot + 1 : nullptr;
}

int programIndex(const char* serverName) {
  static const char* const kinds[] = {"CAP", "APP", "KCAP", "KAPP", "MON"};
  const char* part = lastPart(serverName);
  if (!part) return -1;
  for (int i = 0; i < 5; ++i)
    if (strcmp(part, kinds[i]) == 0) return i;
  return -1;
}

}  // namespace

// ---------------------------------------------------------------------------
// Function codes
// ---------------------------------------------------------------------------
const char* ipcFuncWord(int32_t func) {
  switch (func) {
    case IPC_FUNC_TRCSTART: return "TRCSTART";
    case IPC_FUNC_STOP: return "STOP";
    case IPC_FUNC_STATUS: return "STATUS";
    case IPC_FUNC_QRYPARMS: return "QRYPARMS";
    case IPC_FUNC_RESUME: return "RESUME";
    case IPC_FUNC_SUSPEND: return "SUSPEND";
    case IPC_FUNC_CHGPARMS: return "CHGPARMS";
    case IPC_FUNC_REINIT: return "REINIT";
    case IPC_FUNC_PRUNE: return "PRUNE";
    case IPC_FUNC_REINITQ: return "REINITQ";
    case IPC_FUNC_STARTQ: return "STARTQ";
    case IPC_FUNC_STOPQ: return "STOPQ";
    default: return "";
  }
}

bool ipcFuncKnown(int32_t func) {
  return func == IPC_FUNC_TRCSTART || (func >= IPC_FUNC_STOP && func <= IPC_FUNC_STOPQ) ||
         (func >= IPC_FUNC_STATUS_SIZE && func <= IPC_FUNC_KAPP_SIZE);
}

size_t ipcReplyPayloadLimit(int32_t func) {
  // KCAP detailed status: a length-prefixed text at a 16-bit offset, and a
  // section at another whose text starts 62 bytes in.
  constexpr size_t kKcapDetailsMax = 0xFFFF + 62 + 0xFFFF;
  // KAPP detailed status: 32 bytes, then 12296 bytes per entry.
  constexpr size_t kKappEntries = 4096;
  constexpr size_t kKappDetailsMax = 32 + 12296 * kKappEntries;
  switch (func) {
    case IPC_FUNC_STATUS: return IPC_STATUS_HEADER + IPC_STATUS_RECORD * 0x10000;
    case IPC_FUNC_QRYPARMS: return KLP_QUERY_MSG_MAX;
    case IPC_FUNC_KCAP_DETAILS: return kKcapDetailsMax;
    case IPC_FUNC_KAPP_DETAILS: return kKappDetailsMax;
    default: return IPC_MAX_PAYLOAD;
  }
}

// ---------------------------------------------------------------------------
// Building and putting
// ---------------------------------------------------------------------------
int createReplyMsg(IpcMsg** out, size_t size, int32_t func, int32_t serverPid) {
  if (!out) return KLP_RC_BAD_PARM;
  *out = nullptr;
  if (size < IPC_HEADER_SIZE || size > static_cast<size_t>(INT32_MAX)) return KLP_RC_BAD_PARM;
  IpcMsg* msg = allocMsg(size, "createReplyMsg");
  if (!msg) return KLP_RC_MSG_NO_MEMORY;
  setEyeCatcher(msg);
  msg->msgVersion = IPC_MSG_VERSION;
  msg->msgLength = static_cast<int32_t>(size);
  msg->func = func;
  msg->senderPid = serverPid;
  msg->pieceCount = 1;
  *out = msg;
  return KLP_OK;
}

int createRequestMsg(IpcMsg** out, int32_t func, int32_t subFunc, const char* text) {
  if (!out) return KLP_RC_BAD_PARM;
  *out = nullptr;
  size_t textLen = text ? strlen(text) + 1 : 0;
  if (textLen > IPC_MAX_PAYLOAD) return KLP_RC_TOO_LONG;
  size_t size = IPC_HEADER_SIZE + textLen;
  IpcMsg* msg = allocMsg(size, "createRequestMsg");
  if (!msg) return KLP_RC_MSG_NO_MEMORY;
  setEyeCatcher(msg);
  msg->msgVersion = IPC_MSG_VERSION;
  msg->msgLength = static_cast<int32_t>(size);
  msg->func = func;
  msg->subFunc = subFunc;
  if (textLen) memcpy(msg->payload(), text, textLen);
  *out = msg;
  return KLP_OK;
}

void freeIpcMsg(IpcMsg* msg) { free(msg); }

void stampIpcMsg(IpcMsg* msg) {
  if (!msg) return;
  setEyeCatcher(msg);
  msg->msgVersion = IPC_MSG_VERSION;
  msg->senderPid = hsvProcessID();
  msg->reserved = 0;
}

int putIpcMsg(HSVHIPCQueue* queue, IpcMsg* msg, hsvRC* platformRc) {
  return putIpcMsgWait(queue, msg, HSV_PUT_WAIT_MS, platformRc);
}

int putIpcMsgWait(HSVHIPCQueue* queue, IpcMsg* msg, int32_t waitMs, hsvRC* platformRc) {
  hsvRC rc = ECF_INVALID_ARGUMENT;
  if (queue && msg && msg->msgLength >= static_cast<int32_t>(IPC_HEADER_SIZE) &&
      msg->msgLength <= static_cast<int32_t>(IPC_MAX_MSG_SIZE)) {
    stampIpcMsg(msg);
    if (waitMs < 0) waitMs = HSV_PUT_WAIT_MS;
    rc = queue->putWait(msg, static_cast<size_t>(msg->msgLength), waitMs);
  }
  if (platformRc) *platformRc = rc;
  return rc == ECF_OK ? KLP_OK : IPC_RC_PUT_FAILED;
}

int putIpcReply(HSVHIPCQueue* queue, IpcMsg* reply, int32_t firstWaitMs, int32_t restWaitMs,
                hsvRC* platformRc, const char* origin) {
  if (platformRc) *platformRc = ECF_INVALID_ARGUMENT;
  if (!reply || reply->msgLength < static_cast<int32_t>(IPC_HEADER_SIZE))
    return IPC_RC_PUT_FAILED;
  size_t payloadLen = static_cast<size_t>(reply->msgLength) - IPC_HEADER_SIZE;
  if (payloadLen <= IPC_MAX_PAYLOAD) return putIpcMsgWait(queue, reply, firstWaitMs, platformRc);

  auto* piece = static_cast<IpcMsg*>(malloc(IPC_MAX_MSG_SIZE));
  if (!piece) {
    logKlpMsg(543, origin, KLP_DEST_SEVERITY, "4096", nullptr, 1, "IPC message");
    return KLP_RC_MSG_NO_MEMORY;
  }
  // The pieces after the first share one budget, so a requester that takes
  // a few pieces and then stops cannot hold the sender for long.
  using Clock = std::chrono::steady_clock;
  const Clock::time_point deadline = Clock::now() + std::chrono::milliseconds(restWaitMs);
  stampIpcMsg(reply);
  int rc = KLP_OK;
  int32_t pieces = ipcPieceCount(payloadLen);
  for (int32_t k = 1; rc == KLP_OK && k <= pieces; ++k) {
    int32_t waitMs = firstWaitMs;
    if (k > 1 && restWaitMs >= 0) {
      auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now());
      waitMs = left.count() > 0 ? static_cast<int32_t>(left.count()) : 0;
    } else if (k > 1) {
      waitMs = restWaitMs;
    }
    size_t len = 0;
    if (ipcBuildPiece(reply, k, piece, IPC_MAX_MSG_SIZE, &len) != KLP_OK) {
      if (platformRc) *platformRc = ECF_INVALID_ARGUMENT;
      rc = IPC_RC_PUT_FAILED;
    } else {
      rc = putIpcMsgWait(queue, piece, waitMs, platformRc);
    }
  }
  free(piece);
  return rc;
}

// ---------------------------------------------------------------------------
// Decoding
// ---------------------------------------------------------------------------
int ipcDecodeMsg(const void* buf, size_t received, IpcMsgView* view) {
  if (!view) return KLP_RC_BAD_PARM;
  memset(view, 0, sizeof *view);
  if (!buf || received < IPC_HEADER_SIZE) return KLP_RC_GET_FAILED;
  memcpy(&view->header, buf, IPC_HEADER_SIZE);
  const IpcMsg& h = view->header;
  if (h.msgVersion != IPC_MSG_VERSION) return KLP_RC_BAD_VERSION;
  if (memcmp(h.eyeCatcher, IPC_EYE_CATCHER, 4) != 0) return KLP_RC_GET_FAILED;
  // The queue delivers whole messages, so any disagreement is damage; the
  // received length is the only bound that can be trusted.
  if (h.msgLength < static_cast<int32_t>(IPC_HEADER_SIZE) ||
      static_cast<size_t>(h.msgLength) != received)
    return KLP_RC_GET_FAILED;
  view->payloadLen = received - IPC_HEADER_SIZE;
  view->payload = view->payloadLen ? static_cast<const char*>(buf) + IPC_HEADER_SIZE : nullptr;
  return KLP_OK;
}

size_t ipcPayloadText(const IpcMsgView& view, char* dst, size_t dstSize) {
  if (!dst || dstSize == 0) return 0;
  size_t n = 0;
  if (view.payload) {
    const void* nul = memchr(view.payload, '\0', view.payloadLen);
    n = nul ? static_cast<size_t>(static_cast<const char*>(nul) - view.payload) : view.payloadLen;
  }
  if (n > dstSize - 1) n = dstSize - 1;
  if (n) memcpy(dst, view.payload, n);
  dst[n] = '\0';
  return n;
}

// ---------------------------------------------------------------------------
// Multi-piece replies
// ---------------------------------------------------------------------------
int32_t ipcPieceCount(size_t payloadLen) {
  if (payloadLen <= IPC_MAX_PAYLOAD) return 1;
  size_t n = (payloadLen + IPC_MAX_PAYLOAD - 1) / IPC_MAX_PAYLOAD;
  return n > static_cast<size_t>(INT32_MAX) ? INT32_MAX : static_cast<int32_t>(n);
}

int ipcBuildPiece(const IpcMsg* reply, int32_t pieceNo, void* out, size_t outCap,
                  size_t* outLen) {
  if (outLen) *outLen = 0;
  if (!reply || !out || reply->msgLength < static_cast<int32_t>(IPC_HEADER_SIZE))
    return KLP_RC_BAD_PARM;
  size_t payloadLen = static_cast<size_t>(reply->msgLength) - IPC_HEADER_SIZE;
  int32_t count = ipcPieceCount(payloadLen);
  if (pieceNo < 1 || pieceNo > count) return KLP_RC_BAD_PARM;
  size_t offset = static_cast<size_t>(pieceNo - 1) * IPC_MAX_PAYLOAD;
  size_t chunk = payloadLen - offset;
  if (chunk > IPC_MAX_PAYLOAD) chunk = IPC_MAX_PAYLOAD;
  size_t len = IPC_HEADER_SIZE + chunk;
  if (outCap < len) return KLP_RC_BAD_PARM;
  auto* piece = static_cast<IpcMsg*>(out);
  memcpy(piece, reply, IPC_HEADER_SIZE);
  piece->msgLength = static_cast<int32_t>(len);
  if (count == 1) {
    piece->pieceCount = 1;
    piece->pieceNo = 0;
    piece->totalLength = 0;
  } else {
    piece->pieceCount = count;
    piece->pieceNo = pieceNo;
    piece->totalLength = static_cast<int32_t>(payloadLen);
  }
  memcpy(piece->payload(), reply->payload() + offset, chunk);
  if (outLen) *outLen = len;
  return KLP_OK;
}

IpcGather::~IpcGather() { free(buf_); }

// Room for payloadBytes; grows by doubling up to ceiling, so that a long
// reply is not copied once per piece and a short one holds no more than it
// got.
int IpcGather::reserve(size_t payloadBytes, size_t ceiling) {
  if (payloadBytes <= capacity_ && buf_) return KLP_OK;
  size_t room = capacity_ * 2;
  if (room > ceiling) room = ceiling;
  if (room < payloadBytes) room = payloadBytes;
  // One spare byte keeps a NUL after the payload, so a text payload can be
  // read as a string without trusting the sender to have ended it.
  char* grown = static_cast<char*>(realloc(buf_, IPC_GATHER_HEADER + room + 1));
  if (!grown) return KLP_RC_MSG_NO_MEMORY;
  if (!buf_) memset(grown, 0, IPC_GATHER_HEADER);
  buf_ = grown;
  capacity_ = room;
  return KLP_OK;
}

int IpcGather::add(const IpcMsgView& msg, int32_t* piecesLeft) {
  if (piecesLeft) *piecesLeft = outstanding();
  if (spoiled_) return KLP_RC_GET_FAILED;
  const IpcMsg& h = msg.header;
  size_t len = msg.payloadLen;
  if ((len && !msg.payload) || h.pieceCount < 0 || len > IPC_MAX_PAYLOAD) {
    spoiled_ = true;
    return KLP_RC_GET_FAILED;
  }
  bool first = buf_ == nullptr;
  bool inProgress = expected_ > received_;

  if (!inProgress && h.pieceCount > 1) {
    // The first piece of a multi-piece reply names count and total: they
    // must agree with each other and stay within what the code can need.
    if (h.pieceNo != 1 || h.totalLength <= 0 ||
        static_cast<size_t>(h.totalLength) > ipcReplyPayloadLimit(h.func) ||
        ipcPieceCount(static_cast<size_t>(h.totalLength)) != h.pieceCount) {
      spoiled_ = true;
      return KLP_RC_GET_FAILED;
    }
    expected_ = h.pieceCount;
    received_ = 0;
    total_ = h.totalLength;
    func_ = h.func;
    base_ = used_;
    inProgress = true;
  }

  int rc;
  if (inProgress) {
    size_t offset = static_cast<size_t>(received_) * IPC_MAX_PAYLOAD;
    size_t want = static_cast<size_t>(total_) - offset;
    if (want > IPC_MAX_PAYLOAD) want = IPC_MAX_PAYLOAD;
    if (h.func != func_ || h.pieceCount != expected_ || h.totalLength != total_ ||
        h.pieceNo != received_ + 1 || len != want) {
      spoiled_ = true;
      return KLP_RC_GET_FAILED;
    }
    rc = reserve(base_ + offset + len, base_ + static_cast<size_t>(total_));
  } else {
    rc = reserve(used_ + len, used_ + len);
  }
  if (rc != KLP_OK) return rc;

  if (first) memcpy(buf_, &h.senderPid, sizeof h.senderPid);
  if (len) memcpy(buf_ + IPC_GATHER_HEADER + used_, msg.payload, len);
  used_ += len;
  buf_[IPC_GATHER_HEADER + used_] = '\0';
  int32_t gathered = static_cast<int32_t>(used_);
  memcpy(buf_ + 4, &gathered, sizeof gathered);
  if (inProgress) {
    ++received_;
    if (received_ == expected_) expected_ = received_ = 0;
  }
  if (piecesLeft) *piecesLeft = outstanding();
  return KLP_OK;
}

char* IpcGather::release() {
  if (spoiled_ || !buf_) return nullptr;
  char* out = buf_;
  buf_ = nullptr;
  capacity_ = used_ = 0;
  expected_ = received_ = total_ = func_ = 0;
  base_ = 0;
  return out;
}

// ---------------------------------------------------------------------------
// Queue naming
// ---------------------------------------------------------------------------
int ipcServerQueuePath(char* out, size_t outLen, const char* ipcDir, const char* serverName) {
  if (!out || outLen == 0) return KLP_RC_BAD_PARM;
  int n = snprintf(out, outLen, "%s%s.IPC", ipcDir ? ipcDir : "", serverName ? serverName : "");
  return pathInto(out, outLen, n);
}

int ipcReplyQueuePath(char* out, size_t outLen, const char* ipcDir, const char* serverName,
                      int32_t requesterPid) {
  if (!out || outLen == 0) return KLP_RC_BAD_PARM;
  int n = snprintf(out, outLen, "%s%s.IPC.CMD%d", ipcDir ? ipcDir : "",
                   serverName ? serverName : "", static_cast<int>(requesterPid));
  return pathInto(out, outLen, n);
}

int ipcEnvServerQueuePath(char* out, size_t outLen) {
  klpEnv* env = klpGetEnv();
  return ipcServerQueuePath(out, outLen, getEnvIPCDir(env), getEnvNamePrefix(env));
}

int ipcEnvReplyQueuePath(char* out, size_t outLen, int32_t requesterPid) {
  klpEnv* env = klpGetEnv();
  return ipcReplyQueuePath(out, outLen, getEnvIPCDir(env), getEnvNamePrefix(env), requesterPid);
}

char* ipcNewResIDText(const HSVResID* id) {
  if (!id) return strdup(IPC_RESID_UNKNOWN);
  char text[sizeof(HSVResID) + 16];
  hsvResIDPrintable(*id, text, sizeof text);
  return strdup(text);
}

const char* ipcProgramWord(const char* serverName) {
  static const char* const words[] = {"Capture", "Apply", "K Capture", "K Apply", "Monitor"};
  int i = programIndex(serverName);
  return i < 0 ? "*" : words[i];
}

const char* ipcProgramCmdWord(const char* serverName) {
  static const char* const words[] = {"Capture Commands", "Apply Commands", "K Capture Commands",
                                      "K Apply Commands", "Monitor Commands"};
  int i = programIndex(serverName);
  return i < 0 ? "*" : words[i];
}

// ---------------------------------------------------------------------------
// MsgQe
// ---------------------------------------------------------------------------
namespace {

MsgQe* newMsgQe() {
  MsgQe* qe = new (std::nothrow) MsgQe();  // value-initialised: every field 0
  if (!qe) {
    logKlpMsg(543, "MsgQe", KLP_DEST_SEVERITY, "1128", nullptr, 1, "MsgQe");
    return nullptr;
  }
  qe->ole.initElement("KlpOLE:");
  memset(qe->ole.eyeCatcher, 0, sizeof qe->ole.eyeCatcher);
  memcpy(qe->ole.eyeCatcher, MSGQE_EYE_CATCHER, strlen(MSGQE_EYE_CATCHER));
  qe->ole.object = qe;
  return qe;
}

}  // namespace

int createMsgQe(MsgQe** out, const IpcMsgView& request) {
  if (!out) return KLP_RC_BAD_PARM;
  *out = newMsgQe();
  if (!*out) return KLP_RC_NO_MEMORY;
  MsgQe* qe = *out;
  const IpcMsg& h = request.header;
  qe->QeFunc = h.func;
  qe->QeSubFunc = h.subFunc;
  qe->QeResponseId = h.senderPid;
  size_t n = 0;
  if (h.senderPid != 0) {
    // The payload's bytes as they came, however many the field holds.
    n = request.payload ? request.payloadLen : 0;
    if (n > MSGQE_STRING_SIZE - 1) n = MSGQE_STRING_SIZE - 1;
    if (n) memcpy(qe->QeString, request.payload, n);
    qe->QeString[n] = '\0';
  } else {
    ipcPayloadText(request, qe->QeString, sizeof qe->QeString);
  }
  return KLP_OK;
}

MsgQe* createMsgQeFunc(int32_t func) {
  MsgQe* qe = newMsgQe();
  if (qe) qe->QeFunc = func;
  return qe;
}

void deleteMsgQe(MsgQe* qe) { delete qe; }

void setMsgQeReplyTag(MsgQe* qe, uint64_t tag) {
  if (qe) qe->replyTag = tag;
}

void printMsgQe(const MsgQe* qe) {
  auto addr = [](const void* p) { return static_cast<uint64_t>(reinterpret_cast<uintptr_t>(p)); };
  printf("MsgQe:print entered w/ QE %.*" PRIX64 "\n", 16, addr(qe));
  if (qe) {
    char eye[sizeof qe->ole.eyeCatcher + 1];
    memcpy(eye, qe->ole.eyeCatcher, sizeof qe->ole.eyeCatcher);
    eye[sizeof qe->ole.eyeCatcher] = '\0';
    printf(" QE Addr=%.*" PRIX64 "\n", 16, addr(qe));
    printf(" EyeCatcher=%s\n", eye);
    printf(" Size=%d\n", static_cast<int>(qe->ole.size));
    printf(" prevElement=%.*" PRIX64 "\n", 16, addr(qe->ole.olePrev));
    printf(" nextElement=%.*" PRIX64 "\n", 16, addr(qe->ole.oleNext));
    printf(" QeFunc=%d\n", qe->QeFunc);
    printf(" QeSubFunc=%d\n", qe->QeSubFunc);
    printf(" QeSubFuncInfo=%d\n", qe->QeSubFuncInfo);
    printf(" QeResponseId=%d\n", qe->QeResponseId);
    printf(" QeString=%.*s\n", static_cast<int>(strnlen(qe->QeString, sizeof qe->QeString)),
           qe->QeString);
  }
  printf("MsgQe:print exit for QE %.*" PRIX64 "\n", 16, addr(qe));
  fflush(stdout);
}
