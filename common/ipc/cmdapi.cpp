#include "common/ipc/cmdapi.h"
#include "common/ipc/kcapdetails.h"

#include <cctype>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <mutex>

#include "common/env/klpenv.h"
#include "common/ipc/ipcmsg.h"
#include "common/msg/klplog.h"
#include "common/parms/klpparm.h"
#include "common/thread/klpthread.h"
#include "common/thread/recoverymgr.h"
#include "common/util/klpfmt.h"
#include "common/util/klprc.h"

namespace {

int32_t rd32(const char* p, size_t off) {
  int32_t v;
  std::memcpy(&v, p + off, sizeof(v));
  return v;
}
uint16_t rd16(const char* p, size_t off) {
  uint16_t v;
  std::memcpy(&v, p + off, sizeof(v));
  return v;
}
int64_t rd64(const char* p, size_t off) {
  int64_t v;
  std::memcpy(&v, p + off, sizeof(v));
  return v;
}
void wr32(char* p, size_t off, int32_t v) { std::memcpy(p + off, &v, sizeof(v)); }

// Copies a text of at most srcMax bytes (ended earlier by a NUL) into a
// zeroed field of fieldLen bytes, keeping room for the terminator.
void copyText(char* field, size_t fieldLen, const char* src, size_t srcMax) {
  size_t n = strnlen(src, srcMax);
  if (n > fieldLen - 1) n = fieldLen - 1;
  std::memcpy(field, src, n);
  field[n] = '\0';
}

// A length-prefixed text at payload offset `at` (taken from a 16-bit word).
// Answers 0 with the text, 0 with an empty text when the offset is 0 (there
// is none), or 2017 when the text would run past the payload: an offset or
// length that points elsewhere makes the whole reply malformed.
int prefixedText(const char* payload, size_t len, size_t at, const char** text,
                 size_t* textLen) {
  *text = "";
  *textLen = 0;
  if (at == 0) return 0;
  if (at + 2 > len) return KLP_API_BAD_REPLY;
  size_t n = rd16(payload, at);
  if (at + 2 + n > len) return KLP_API_BAD_REPLY;
  *text = payload + at + 2;
  *textLen = n;
  return 0;
}

}  // namespace

// ---------------------------------------------------------------------------
// Names and words
// ---------------------------------------------------------------------------

int32_t klpThreadKind(const char* name) {
  static const struct {
    const char* kindName;
    int32_t kind;
  } kinds[] = {
      {"AdminThread", KLP_THREAD_KIND_ADMIN},   {"BehinderWorkerThread", KLP_THREAD_KIND_BEHINDER},
      {"HoldLThread", KLP_THREAD_KIND_HOLDL},   {"PruneThread", KLP_THREAD_KIND_PRUNE},
      {"WorkerThread", KLP_THREAD_KIND_WORKER}, {"MonitorThread", KLP_THREAD_KIND_MONITOR},
      {"LogRdrThread", KLP_THREAD_KIND_LOGRDR},
  };
  // Thread names are cut to 14 characters, so a name of exactly that length
  // may be the start of a longer kind name.
  constexpr size_t kNameMax = 14;
  size_t len = std::strlen(name);
  for (const auto& k : kinds) {
    size_t kl = std::strlen(k.kindName);
    if (len >= kl && std::strncmp(name, k.kindName, kl) == 0) return k.kind;
    if (len == kNameMax && kl > kNameMax && std::strncmp(name, k.kindName, kNameMax) == 0)
      return k.kind;
  }
  if (len >= 2 && name[0] == 'B' && name[1] == 'R')
    return (len >= 8 && name[7] == 'A') ? KLP_THREAD_KIND_BROWSER_A : KLP_THREAD_KIND_BROWSER;
  return KLP_THREAD_KIND_OTHER;
}

static const char* kindWord(int32_t kind) {
  switch (kind) {
    case KLP_KIND_APP: return "APP";
    case KLP_KIND_KAPP: return "KAPP";
    case KLP_KIND_CAP: return "CAP";
    case KLP_KIND_KCAP: return "KCAP";
    case KLP_KIND_MON: return "MON";
    default: return nullptr;
  }
}

// A caller's name field: at most 128 characters, ended by a blank or NUL.
static size_t fieldLength(const char* s) {
  size_t n = 0;
  while (n < 128 && s[n] != '\0' && s[n] != ' ') ++n;
  return n;
}

int klpBuildServerName(int32_t kind, const char* server, const char* schema, char* out,
                       size_t outLen) {
  const char* word = kindWord(kind);
  if (!word) return KLP_API_BAD_KIND;
  size_t sl = server ? fieldLength(server) : 0;
  if (sl == 0) return KLP_API_NO_SERVER;
  size_t cl = schema ? fieldLength(schema) : 0;
  if (cl == 0) return KLP_API_NO_SCHEMA;
  char up[2][129];
  for (size_t i = 0; i < sl; ++i)
    up[0][i] = static_cast<char>(std::toupper(static_cast<unsigned char>(server[i])));
  up[0][sl] = '\0';
  for (size_t i = 0; i < cl; ++i)
    up[1][i] = static_cast<char>(std::toupper(static_cast<unsigned char>(schema[i])));
  up[1][cl] = '\0';
  if (klpBuildNamePrefix(out, outLen, up[0], up[1], word) != 0) {
    if (outLen) out[0] = '\0';
    return KLP_API_BAD_NAME;
  }
  return 0;
}

int klpMapCmdRc(int rc) {
  switch (rc) {
    case KLP_RC_NO_REPLY: return KLP_API_NO_REPLY;
    case KLP_RC_ATTACH_FAILED: return KLP_API_NOT_ATTACHABLE;
    case KLP_RC_QUEUE_UNAVAILABLE: return KLP_API_NO_REPLY_QUEUE;
    case KLP_RC_PUT_FAILED: return KLP_API_PUT_FAILED;
    case KLP_RC_GET_FAILED: return KLP_API_GET_FAILED;
    case KLP_RC_BAD_VERSION: return KLP_API_BAD_REPLY;
    default: return rc;
  }
}

// ---------------------------------------------------------------------------
// Status data
// ---------------------------------------------------------------------------

int klpStatusFromThreads(const char* payload, size_t len, char* out, size_t outLen,
                         int32_t* required) {
  constexpr size_t kHead = 12, kRec = 20, kOutHead = 8, kOutRec = sizeof(klpStatusThread);
  *required = 0;
  if (!payload || len < kHead) return KLP_API_BAD_REPLY;
  int32_t count = rd32(payload, 8);
  if (count < 0 || kHead + kRec * static_cast<uint64_t>(count) > len) return KLP_API_BAD_REPLY;
  *required = static_cast<int32_t>(kOutHead + kOutRec * static_cast<size_t>(count ? count : 1));
  if (!out || outLen < kOutHead) return KLP_API_BUFFER_TOO_SMALL;
  size_t fit = (outLen - kOutHead) / kOutRec;
  size_t n = static_cast<size_t>(count) < fit ? static_cast<size_t>(count) : fit;
  wr32(out, 0, 1);
  wr32(out, 4, static_cast<int32_t>(n));
  for (size_t i = 0; i < n; ++i) {
    const char* in = payload + kHead + kRec * i;
    klpStatusThread rec;
    std::memset(&rec, 0, sizeof(rec));
    copyText(rec.name, sizeof(rec.name), in, 15);
    rec.kind = klpThreadKind(rec.name);
    rec.state = rd32(in, 16);
    std::memcpy(out + kOutHead + kOutRec * i, &rec, sizeof(rec));
  }
  return n < static_cast<size_t>(count) ? KLP_API_BUFFER_TOO_SMALL : 0;
}

int klpStatusFromKcap(const char* payload, size_t len, char* out, size_t outLen,
                      int32_t* required) {
  *required = KLP_STATUS_FMT3_SIZE;
  if (!payload || len < kcapDetails::kMinSize) return KLP_API_BAD_REPLY;
  // Everything the offsets name must lie inside the payload, whether or not
  // the caller's buffer takes the data this time.
  const char *logFile, *sectionText;
  size_t logFileLen, sectionTextLen;
  if (prefixedText(payload, len, rd16(payload, kcapDetails::kLogFileRef), &logFile, &logFileLen))
    return KLP_API_BAD_REPLY;
  size_t sec = rd16(payload, kcapDetails::kSectionRef);
  if (sec != 0 && sec + 62 > len) return KLP_API_BAD_REPLY;
  if (sec != 0 && prefixedText(payload, len, sec + 60, &sectionText, &sectionTextLen))
    return KLP_API_BAD_REPLY;
  if (!out || outLen < KLP_STATUS_FMT3_SIZE) return KLP_API_BUFFER_TOO_SMALL;
  klpStatusFmt3 s;
  std::memset(&s, 0, sizeof(s));
  s.format = 3;
  s.upTime = rd32(payload, kcapDetails::kUpTime);
  copyText(s.logFile, sizeof(s.logFile), logFile, logFileLen);
  s.activeSubs = rd32(payload, kcapDetails::kActiveSubs);
  copyText(s.currentLogTime, sizeof(s.currentLogTime), payload + kcapDetails::kLogTime,
           kcapDetails::kLogTimeLen);
  // The log sequence number in text form, upper case.
  uint8_t lsn[kcapDetails::kLsnLen];
  std::memcpy(lsn, payload + kcapDetails::kLsn, sizeof(lsn));
  char lsnText[50];
  if (formatLsn(lsnText, sizeof(lsnText), "", lsn, "") > 0) {
    for (char* c = lsnText; *c; ++c) *c = static_cast<char>(std::toupper(static_cast<unsigned char>(*c)));
    copyText(s.allPublishedLsn, sizeof(s.allPublishedLsn), lsnText, sizeof(lsnText));
  }
  s.currentMemory = rd32(payload, kcapDetails::kMemory);
  if (sec != 0) {
    std::memcpy(s.sectionA, payload + sec, 30);
    std::memcpy(s.sectionB, payload + sec + 30, 30);
    copyText(s.sectionText, sizeof(s.sectionText), sectionText, sectionTextLen);
  }
  std::memcpy(out, &s, sizeof(s));
  return 0;
}

int klpStatusFromKapp(const char* payload, size_t len, char* out, size_t outLen,
                      int32_t* required) {
  constexpr size_t kInFirst = 32, kInRec = 12296;
  constexpr size_t kOutHead = sizeof(klpStatusFmt2), kOutRec = sizeof(klpStatusFmt2Record);
  *required = 0;
  if (!payload || len < kInFirst) return KLP_API_BAD_REPLY;
  int32_t count = rd32(payload, 12);
  if (count < 0 || kInFirst + kInRec * static_cast<uint64_t>(count) > len)
    return KLP_API_BAD_REPLY;
  uint64_t need = kOutHead + kOutRec * static_cast<uint64_t>(count ? count : 1);
  if (need > INT32_MAX) return KLP_API_BAD_REPLY;
  const char* text;
  size_t textLen;
  if (prefixedText(payload, len, rd16(payload, 20), &text, &textLen)) return KLP_API_BAD_REPLY;
  *required = static_cast<int32_t>(need);
  if (!out || outLen < KLP_STATUS_FMT2_MIN) return 0;
  size_t fit = (outLen - kOutHead) / kOutRec;
  size_t n = static_cast<size_t>(count) < fit ? static_cast<size_t>(count) : fit;

  klpStatusFmt2 h;
  std::memset(&h, 0, sizeof(h));
  h.format = 2;
  h.count = static_cast<int32_t>(n);
  h.value8 = rd32(payload, 16);
  copyText(h.text, sizeof(h.text), text, textLen);
  h.value1040 = rd32(payload, 24);
  h.value1044 = rd32(payload, 28);
  std::memcpy(out, &h, sizeof(h));

  for (size_t i = 0; i < n; ++i) {
    const char* in = payload + kInFirst + kInRec * i;
    char* rec = out + kOutHead + kOutRec * i;
    std::memset(rec, 0, kOutRec);
    std::memcpy(rec, in, 48);
    std::memcpy(rec + 52, in + 52, 4);
    std::memcpy(rec + 56, in + 56, 26);
    std::memcpy(rec + 83, in + 83, 64);
    std::memcpy(rec + 148, in + 148, 64);
    std::memcpy(rec + 213, in + 213, 26);
    std::memcpy(rec + 240, in + 240, 8);
    int16_t w;
    std::memcpy(&w, in + 248, 2);
    wr32(rec, 248, w);
    for (int k = 0; k < 4; ++k) wr32(rec, 252 + 4 * k, static_cast<int32_t>(rd64(in, 256 + 8 * k)));
    static const size_t inText[4] = {288, 3289, 6290, 9291};
    static const size_t outText[4] = {268, 3269, 6270, 9271};
    for (int k = 0; k < 4; ++k) copyText(rec + outText[k], 3001, in + inText[k], 3001);
  }
  return 0;
}

// ---------------------------------------------------------------------------
// Issuing messages, or collecting their texts for a caller
// ---------------------------------------------------------------------------
namespace {

void appendCapture(klpMsgCapture* cap, const char* text, size_t n) {
  size_t used = cap->length > KLP_CAPTURE_CHARS ? KLP_CAPTURE_CHARS : cap->length;
  if (used > 0 && used < static_cast<size_t>(KLP_CAPTURE_CHARS)) cap->text[used++] = '\n';
  size_t room = KLP_CAPTURE_CHARS - used;
  if (n > room) n = room;
  std::memcpy(cap->text + used, text, n);
  used += n;
  cap->text[used] = '\0';
  cap->length = static_cast<uint16_t>(used);
}

// Issues message `number` with up to four values; with a capture buffer the
// text is collected there instead.
void issue(klpMsgCapture* cap, int number, const char* origin, int dest, const char* v1 = nullptr,
           const char* v2 = nullptr, const char* v3 = nullptr, const char* v4 = nullptr) {
  int count = v4 ? 3 : v3 ? 2 : v2 ? 1 : 0;
  if (!cap) {
    logKlpMsg(number, origin, dest, v1, nullptr, count, v2, v3, v4);
    return;
  }
  char buf[2 + KLP_CAPTURE_CHARS + 1];
  std::memset(buf, 0, sizeof(buf));
  klpMsgCtx ctx{};
  ctx.wantText = 1;
  ctx.bufferChars = KLP_CAPTURE_CHARS + 1;
  ctx.buffer = buf;
  if (logKlpMsg(number, origin, dest, v1, &ctx, count, v2, v3, v4) != 0) return;
  uint16_t len;
  std::memcpy(&len, buf, sizeof(len));
  if (len > KLP_CAPTURE_CHARS) len = KLP_CAPTURE_CHARS;
  appendCapture(cap, buf + 2, strnlen(buf + 2, len));
}

// Message 589 and, with a detail, 8999 with it; both visible to the caller.
void internalError(klpMsgCapture* cap, const char* origin, int rc, const char* operation,
                   const char* detail) {
  char code[16];
  std::snprintf(code, sizeof(code), "%d", rc);
  issue(cap, 589, origin, KLP_DEST_SEVERITY, origin, code, operation);
  if (detail && *detail) issue(cap, -1, origin, KLP_DEST_SEVERITY, detail);
}

// Shows the calling thread as resting while it waits, unless it waits for
// the database.
class RestingState {
 public:
  RestingState() : t_(currentThread()) {
    if (t_) {
      saved_ = t_->getState();
      if (saved_ != KLP_THREAD_DBWAIT) t_->setState(KLP_THREAD_REST);
    }
  }
  ~RestingState() {
    if (t_) t_->setState(saved_);
  }
  RestingState(const RestingState&) = delete;
  RestingState& operator=(const RestingState&) = delete;

 private:
  klpThread* t_;
  int32_t saved_ = 0;
};

// A queue held across a possible signal. The object and the pointer the
// recovery action clears live on the heap, since a jump back to the
// recovery point abandons this frame before the action runs.
struct HeldQueue {
  HSVHIPCQueue* queue = nullptr;
  recoveryRes* res = nullptr;
};

// A queue object not yet attached or created, whose recovery action
// (erHSVIPCQdetach or erHSVIPCQdestroy) is registered before the queue
// exists: a signal right after the attach or create still undoes it, and
// one before finds nothing to undo. Null when memory ran out.
HeldQueue* newHeld(recoveryAction action) {
  HeldQueue* held = new (std::nothrow) HeldQueue;
  if (held) held->queue = new (std::nothrow) HSVHIPCQueue;
  if (!held || !held->queue) {
    delete held;
    return nullptr;
  }
  held->res = addRcvyRes(action, reinterpret_cast<uint64_t>(&held->queue));
  return held;
}

// Detaches or destroys the queue, and only then drops its recovery action:
// a signal in between finds the queue closed and leaves it be. Held becomes
// null.
void releaseHeld(HeldQueue*& held, bool destroy) {
  if (!held) return;
  if (held->queue) {
    if (destroy)
      held->queue->destroy();
    else
      held->queue->detach();
  }
  endRcvyRes(held->res);
  HeldQueue* h = held;
  held = nullptr;
  delete h->queue;
  delete h;
}

const char* const kOrigin = "cmdAPIFunc";

}  // namespace

int KLPAttachIPCQ(HSVHIPCQueue* queue, char* resId, size_t resIdLen, const char* path,
                  hsvRC* platformRc) {
  *platformRc = 0;
  if (resIdLen) std::snprintf(resId, resIdLen, "%s", IPC_RESID_UNKNOWN);
  for (int attempt = 1; attempt <= KLP_ATTACH_ATTEMPTS; ++attempt) {
    HSVResID id;
    hsvRC rc = hsvIPCGetQueResID(path, HSV_QUEUE_RESID_OPTION, &id);
    if (rc == ECF_OK) {
      char* text = ipcNewResIDText(&id);
      if (text && resIdLen) std::snprintf(resId, resIdLen, "%s", text);
      std::free(text);
      rc = queue->attach(id);
      if (rc == ECF_OK) return 0;
    }
    *platformRc = rc;
    // Another user's object, or one open to others, stays so: no retry.
    if (rc == ECF_NOT_OWNED) break;
    if (attempt < KLP_ATTACH_ATTEMPTS) klpRestingSleep(KLP_CMD_PAUSE_MS);
  }
  return KLP_RC_ATTACH_FAILED;
}

int printState(const char* payload, size_t len, klpMsgCapture* capture) {
  if (!payload || len < IPC_STATUS_HEADER) return KLP_RC_PRINT_FAILED;
  int32_t count = rd32(payload, 8);
  if (count < 0 || IPC_STATUS_HEADER + IPC_STATUS_RECORD * static_cast<uint64_t>(count) > len)
    return KLP_RC_PRINT_FAILED;
  for (int32_t i = 0; i < count; ++i) {
    const char* rec = payload + IPC_STATUS_HEADER + IPC_STATUS_RECORD * static_cast<size_t>(i);
    char name[IPC_STATUS_NAME];
    copyText(name, sizeof(name), rec, IPC_STATUS_NAME);
    issue(capture, 520, "printState", KLP_DEST_CONSOLE, name, threadStateText(rd32(rec, 16)));
  }
  return 0;
}

namespace {

// Prints one complete reply (no reply buffer wanted).
int printReply(const IpcMsg& header, const char* payload, size_t len, klpMsgCapture* cap) {
  klpParmClass* parms = klpGetCurrentParms();
  if (header.func == IPC_FUNC_STATUS) {
    int rc = printState(payload, len, cap);
    if (rc != 0) {
      internalError(cap, kOrigin, rc, "printState", "thread records beyond the reply");
      return KLP_RC_PRINT_FAILED;
    }
    return 0;
  }
  if (header.func == IPC_FUNC_QRYPARMS) {
    int rc = parms ? parms->getQueryMsg(payload, len) : KLP_RC_BAD_PARM;
    if (rc != 0) {
      internalError(cap, kOrigin, rc, "getQueryMsg", nullptr);
      return KLP_RC_PRINT_FAILED;
    }
    return 0;
  }
  if (header.func == IPC_FUNC_CHGPARMS) {
    klpParmClass* server = parms ? parms->getServerParms() : nullptr;
    const char* name = nullptr;
    if (server && header.subFunc >= 0 && header.subFunc < KLP_PARM_SLOTS)
      name = server->getParmName(header.subFunc);
    char value[KLP_PARM_VALUE_MAX + 1];
    copyText(value, sizeof(value), payload ? payload : "", payload ? len : 0);
    issue(cap, 523, kOrigin, KLP_DEST_CONSOLE, name, value);
    return 0;
  }
  const char* name = nullptr;
  if (parms && header.func >= 0 && header.func < KLP_PARM_SLOTS) name = parms->getParmName(header.func);
  issue(cap, 522, kOrigin, KLP_DEST_CONSOLE, name);
  return 0;
}

// Puts one request, with text (and its NUL) as payload when text is not
// null; 0, 1003 or 805 (messages issued).
int putRequest(HSVHIPCQueue* queue, int func, int subFunc, const char* text, const char* resId,
               const char* path, klpMsgCapture* cap) {
  IpcMsg* msg = nullptr;
  int rc = createRequestMsg(&msg, func, subFunc, text);
  if (rc == KLP_RC_MSG_NO_MEMORY) return rc;
  if (rc != 0) {
    // Longer than one message can carry: refused rather than cut.
    issue(cap, 508, kOrigin, KLP_DEST_SEVERITY);
    internalError(cap, kOrigin, rc, "createRequestMsg", "request text longer than one message");
    return KLP_RC_PUT_FAILED;
  }
  hsvRC prc = 0;
  rc = putIpcMsg(queue, msg, &prc);
  freeIpcMsg(msg);
  if (rc != 0) {
    issue(cap, 508, kOrigin, KLP_DEST_SEVERITY);
    if (prc) issue(cap, 601, kOrigin, KLP_DEST_SEVERITY, resId, path, ecfErrorGetDescription(prc));
    return KLP_RC_PUT_FAILED;
  }
  return 0;
}

// Creates the reply queue; a queue of the same name left by an earlier
// process with our id is stale and is replaced.
hsvRC createReplyQueue(HSVHIPCQueue* q, const HSVResID& id) {
  hsvRC rc = q->create(id, HSV_MAX_MSG_SIZE, HSV_CREATE_OPTION);
  if (rc != ECF_ALREADY_EXISTS) return rc;
  if (q->attach(id) == ECF_OK) q->destroy();
  return q->create(id, HSV_MAX_MSG_SIZE, HSV_CREATE_OPTION);
}

// One exchange at a time per process: the reply queue is named by the
// process id alone, so a second exchange at once would replace the first
// one's queue and take its reply.
std::mutex exchangeLock;

// What one exchange holds. It lives on the heap because a trap jumps past
// the exchange's frame: the queue actions registered later run first, then
// this state's own resource frees what is left and lets the next exchange
// go.
struct CallState {
  HeldQueue* server = nullptr;
  HeldQueue* reply = nullptr;
  IpcGather gather;
  char msg[HSV_MAX_MSG_SIZE];
  recoveryRes* res = nullptr;
  bool holdsLock = false;
};

void freeCallState(uint64_t arg) {
  CallState* st = reinterpret_cast<CallState*>(arg);
  for (HeldQueue* h : {st->server, st->reply}) {
    if (!h) continue;
    delete h->queue;  // null when its own action already ran
    delete h;
  }
  if (st->holdsLock) exchangeLock.unlock();
  delete st;
}

int exchange(CallState* st, const char* serverName, int func, const char* payload,
             char** replyBuf, klpMsgCapture* cap);

}  // namespace

int cmdAPIFunc(const char* serverName, int func, const char* payload, char** replyBuf,
               klpMsgCapture* capture) {
  if (replyBuf) *replyBuf = nullptr;
  CallState* st = new (std::nothrow) CallState;
  if (!st) return KLP_RC_MSG_NO_MEMORY;
  st->res = addRcvyRes(freeCallState, reinterpret_cast<uint64_t>(st));
  exchangeLock.lock();
  st->holdsLock = true;
  int rc = exchange(st, serverName, func, payload, replyBuf, capture);
  st->holdsLock = false;
  exchangeLock.unlock();
  endRcvyRes(st->res);
  delete st;
  return rc;
}

namespace {

int exchange(CallState* st, const char* serverName, int func, const char* payload,
             char** replyBuf, klpMsgCapture* cap) {
  // 1-3: the server queue.
  char path[KLP_ENV_PATH_MAX + KLP_UNIQUE_NAME_SIZE + 32];
  if (!serverName ||
      ipcServerQueuePath(path, sizeof(path), getEnvIPCDir(klpGetEnv()), serverName) != 0) {
    issue(cap, 506, kOrigin, KLP_DEST_SEVERITY, ipcProgramWord(serverName));
    return KLP_RC_ATTACH_FAILED;
  }
  HeldQueue*& server = st->server;
  server = newHeld(erHSVIPCQdetach);
  if (!server) return KLP_RC_MSG_NO_MEMORY;
  char serverId[160];
  hsvRC prc = 0;
  int rc = KLPAttachIPCQ(server->queue, serverId, sizeof(serverId), path, &prc);
  if (rc != 0) {
    issue(cap, 506, kOrigin, KLP_DEST_SEVERITY, ipcProgramWord(serverName));
    if (prc) issue(cap, 597, kOrigin, KLP_DEST_SEVERITY, serverId, path, ecfErrorGetDescription(prc));
    releaseHeld(server, false);
    return rc;
  }
  issue(cap, 592, kOrigin, KLP_DEST_SEVERITY, serverId);

  // 4: the reply queue.
  char replyPath[KLP_ENV_PATH_MAX + KLP_UNIQUE_NAME_SIZE + 48];
  std::snprintf(replyPath, sizeof(replyPath), "%s.CMD%d", path, hsvProcessID());
  HeldQueue*& reply = st->reply;
  reply = newHeld(erHSVIPCQdestroy);
  if (!reply) {
    releaseHeld(server, false);
    return KLP_RC_MSG_NO_MEMORY;
  }
  char replyId[160];
  std::snprintf(replyId, sizeof(replyId), "%s", IPC_RESID_UNKNOWN);
  HSVResID rid;
  prc = hsvIPCGetQueResID(replyPath, HSV_QUEUE_RESID_OPTION, &rid);
  if (prc == ECF_OK) {
    char* text = ipcNewResIDText(&rid);
    if (text) std::snprintf(replyId, sizeof(replyId), "%s", text);
    std::free(text);
    prc = createReplyQueue(reply->queue, rid);
  }
  if (prc != ECF_OK) {
    issue(cap, 596, kOrigin, KLP_DEST_SEVERITY, replyId, replyPath, ecfErrorGetDescription(prc));
    issue(cap, 507, kOrigin, KLP_DEST_SEVERITY);
    releaseHeld(reply, false);  // never created: nothing to destroy
    releaseHeld(server, false);
    return KLP_RC_QUEUE_UNAVAILABLE;
  }
  issue(cap, 594, kOrigin, KLP_DEST_SEVERITY, replyId);

  // 5: send.
  int outstanding = 0;
  if (func == IPC_FUNC_CHGPARMS) {
    klpParmClass* parms = klpGetCurrentParms();
    for (int i = 0; parms && rc == 0 && i < KLP_PARM_SLOTS; ++i) {
      const ChgParmsEntry* e = parms->getChgParmsEntry(i);
      if (!e || e->index < 0) continue;
      char value[KLP_PARM_VALUE_MAX + 1];
      copyText(value, sizeof(value), e->value, sizeof(e->value));
      rc = putRequest(server->queue, func, e->index, value, serverId, path, cap);
      if (rc == 0) ++outstanding;
    }
  } else if (func != KLP_FUNC_NONE) {
    // A missing text or the shared empty text sends none; a changed
    // parameter's value above always goes, even when empty.
    if (payload && (payload == klpEmptyText || *payload == '\0')) payload = nullptr;
    rc = putRequest(server->queue, func, 0, payload, serverId, path, cap);
    if (rc == 0) outstanding = 1;
  }

  // 6-7: wait for the replies. Each pause ends as soon as a message arrives.
  IpcGather& gather = st->gather;
  int emptyPolls = 0;
  int dropped = 0;
  char* msgBuf = st->msg;
  while (rc == 0 && outstanding > 0) {
    if (!reply->queue->hasMessage()) {
      if (++emptyPolls >= KLP_CMD_POLLS) {
        issue(cap, 510, kOrigin, KLP_DEST_SEVERITY);
        rc = KLP_RC_NO_REPLY;
        break;
      }
      RestingState resting;
      reply->queue->waitForMessage(KLP_CMD_PAUSE_MS);
      continue;
    }
    size_t got = 0;
    hsvRC grc = reply->queue->get(msgBuf, HSV_MAX_MSG_SIZE, &got, KLP_CMD_GET_TIMEOUT_MS);
    if (grc == ECF_TIMEOUT) {
      issue(cap, 510, kOrigin, KLP_DEST_SEVERITY);
      issue(cap, 602, kOrigin, KLP_DEST_SEVERITY, replyId, replyPath, ecfErrorGetDescription(grc));
      rc = KLP_RC_NO_REPLY;
      break;
    }
    if (grc != ECF_OK) {
      issue(cap, 525, kOrigin, KLP_DEST_SEVERITY);
      issue(cap, 602, kOrigin, KLP_DEST_SEVERITY, replyId, replyPath, ecfErrorGetDescription(grc));
      rc = KLP_RC_GET_FAILED;
      break;
    }
    IpcMsgView view;
    int drc = ipcDecodeMsg(msgBuf, got, &view);
    if (drc == KLP_RC_BAD_VERSION) {
      rc = KLP_RC_BAD_VERSION;
      break;
    }
    if (drc != 0) {
      issue(cap, 525, kOrigin, KLP_DEST_SEVERITY);
      internalError(cap, kOrigin, drc, "ipcDecodeMsg", "reply is not a whole command-channel message");
      rc = KLP_RC_GET_FAILED;
      break;
    }
    // A late reply to an earlier exchange that gave up waiting reaches this
    // one's queue of the same name: it is not this request's answer. A
    // queue's worth of them is forgiven; past that each counts as an empty
    // poll, so a sender that keeps answering another request cannot hold
    // the exchange beyond its budget.
    if (view.header.func != func) {
      if (++dropped > HSV_QUEUE_DEPTH && ++emptyPolls >= KLP_CMD_POLLS) {
        issue(cap, 510, kOrigin, KLP_DEST_SEVERITY);
        rc = KLP_RC_NO_REPLY;
      }
      continue;
    }
    int32_t piecesLeft = 0;
    int arc = gather.add(view, &piecesLeft);
    if (arc == KLP_RC_MSG_NO_MEMORY) {
      issue(cap, 543, kOrigin, KLP_DEST_SEVERITY, "4096", "IPC message");
      rc = arc;
      break;
    }
    if (arc != 0) {
      char detail[160];
      std::snprintf(detail, sizeof(detail),
                    "reply piece %d of %d (total %d bytes) does not fit the reply being gathered",
                    view.header.pieceNo, view.header.pieceCount, view.header.totalLength);
      internalError(cap, kOrigin, arc, "IpcGather::add", detail);
      rc = arc;
      break;
    }
    if (piecesLeft > 0) continue;
    --outstanding;
    if (!replyBuf) {
      // Printed replies are taken one at a time.
      char* one = gather.release();
      size_t len = 0;
      if (one) {
        int32_t l = rd32(one, 4);
        len = l > 0 ? static_cast<size_t>(l) : 0;
      }
      rc = printReply(view.header, one ? one + KLP_REPLY_HEADER : nullptr, len, cap);
      std::free(one);
    }
  }
  if (rc == 0 && replyBuf) *replyBuf = gather.release();

  // 8: clean up.
  releaseHeld(server, false);
  releaseHeld(reply, true);
  return rc;
}

}  // namespace

int KLPResponseFunc(int32_t requesterPid, IpcMsg* replyMsg) {
  static const char* const origin = "KLPResponseFunc";
  if (!replyMsg || replyMsg->msgLength < static_cast<int32_t>(IPC_HEADER_SIZE))
    return KLP_RC_BAD_PARM;
  char path[KLP_ENV_PATH_MAX + KLP_UNIQUE_NAME_SIZE + 32];
  if (ipcEnvReplyQueuePath(path, sizeof(path), requesterPid) != 0) return KLP_RC_ATTACH_FAILED;

  HeldQueue* held = newHeld(erHSVIPCQdetach);
  if (!held) return KLP_RC_MSG_NO_MEMORY;
  char resId[160];
  hsvRC prc = 0;
  int rc = KLPAttachIPCQ(held->queue, resId, sizeof(resId), path, &prc);
  if (rc != 0) {
    releaseHeld(held, false);
    return rc;
  }
  issue(nullptr, 592, origin, KLP_DEST_SEVERITY, resId);

  rc = putIpcReply(held->queue, replyMsg, HSV_PUT_WAIT_MS, -1, &prc, origin);
  if (rc == IPC_RC_PUT_FAILED) rc = KLP_RC_PUT_FAILED;
  if (rc == KLP_RC_PUT_FAILED) {
    issue(nullptr, 508, origin, KLP_DEST_SEVERITY);
    logInternalError(origin, rc, "HSVHIPCQueue::put", ecfErrorGetDescription(prc));
  }
  releaseHeld(held, false);
  return rc;
}

int KLPCmdFunc() {
  klpParmClass* parms = klpGetCurrentParms();
  int func = parms ? parms->getNamedCommand() : KLP_FUNC_NONE;
  const char* payload = func >= 0 ? parms->getCommandText(func) : nullptr;
  const char* prefix = getEnvNamePrefix(klpGetEnv());
  if (!prefix) return KLP_RC_NO_SERVER;
  return cmdAPIFunc(prefix, func, payload, nullptr, nullptr);
}

int KLPMonFunc(const char* name, const char* suffix, klpMsgCapture* capture) {
  char server[KLP_UNIQUE_NAME_SIZE + 64];
  int n = std::snprintf(server, sizeof(server), "%s.%s", name ? name : "", suffix ? suffix : "");
  if (n < 0 || static_cast<size_t>(n) >= sizeof(server)) {
    // A cut name would address some other server.
    internalError(capture, "KLPMonFunc", KLP_API_BAD_NAME, "server name",
                  "the server name and its suffix do not fit a server name");
    return KLP_API_BAD_NAME;
  }
  return cmdAPIFunc(server, IPC_FUNC_STATUS, nullptr, nullptr, capture);
}

// ---------------------------------------------------------------------------
// The status collector
// ---------------------------------------------------------------------------

void klpEnsureMainThread() {
  // A caller of the control interface may never have run a prologue; the
  // thread list and the recovery manager must know the calling thread. Two
  // of its threads may call at once: the prologue runs once.
  static std::mutex once;
  std::lock_guard<std::mutex> hold(once);
  klpThread* main = klpMainThread();
  if (main && main->getState() == KLP_THREAD_EXIST) klpThread::prologue(main);
}

static bool releaseOk(const klpReleaseInfo* r) {
  return r->version == KLP_API_VERSION && r->release == KLP_API_RELEASE &&
         r->modification == KLP_API_MODIFICATION;
}

// The payload of a reply buffer and its length (null and 0 for none).
static const char* replyPayload(const char* reply, size_t* len) {
  int32_t l = reply ? rd32(reply, 4) : 0;
  *len = l > 0 ? static_cast<size_t>(l) : 0;
  return reply ? reply + KLP_REPLY_HEADER : nullptr;
}

int klpStatusSizeFromReply(int32_t kind, const char* reply, int32_t* size,
                           klpMsgCapture* capture) {
  *size = 0;
  size_t len = 0;
  const char* payload = replyPayload(reply, &len);
  int32_t count = -1;
  if (payload && len >= IPC_SISIZE_TEXT_SIZE + 4 &&
      std::memcmp(payload, IPC_SISIZE_TEXT, IPC_SISIZE_TEXT_SIZE) == 0)
    count = rd32(payload, IPC_SISIZE_TEXT_SIZE);
  int64_t n = count > 0 ? count : 1;
  int64_t need = kind == KLP_KIND_KAPP
                     ? static_cast<int64_t>(sizeof(klpStatusFmt2)) +
                           static_cast<int64_t>(sizeof(klpStatusFmt2Record)) * n
                     : 8 + static_cast<int64_t>(sizeof(klpStatusThread)) * n;
  if (count < 0 || need > INT32_MAX) {
    internalError(capture, "klpGetStatusSize", KLP_API_BAD_REPLY, "status size",
                  "the reply is not a status size reply");
    return KLP_API_BAD_REPLY;
  }
  *size = static_cast<int32_t>(need);
  return 0;
}

static void copyCapture(klpResultBlock* result, const klpMsgCapture* cap) {
  if (!result || !cap) return;
  copyText(result->text, sizeof(result->text), cap->text, sizeof(cap->text));
}

int klpCollectStatus(const klpReleaseInfo* release, klpStatusRequest* request,
                     klpResultBlock* result, klpMsgCapture* capture) {
  auto done = [result](int rc) {
    if (result) result->rc = static_cast<int16_t>(rc);
    return rc;
  };
  if (!release || !request) return done(KLP_API_MISSING_ARG);
  if (!releaseOk(release)) return done(KLP_API_BAD_RELEASE);
  int32_t kind = release->kind;
  if (kind < KLP_KIND_APP || kind > KLP_KIND_MON) return done(KLP_API_BAD_KIND);
  char name[KLP_UNIQUE_NAME_SIZE];
  int rc = klpBuildServerName(kind, request->serverName, request->schema, name, sizeof(name));
  if (rc != 0) return done(rc);
  klpEnsureMainThread();

  int func = kind == KLP_KIND_KCAP   ? IPC_FUNC_KCAP_DETAILS
             : kind == KLP_KIND_KAPP ? IPC_FUNC_KAPP_DETAILS
                                     : IPC_FUNC_STATUS;
  if (result) std::memset(result, 0, sizeof(*result));
  if (capture) std::memset(capture, 0, sizeof(*capture));
  char* reply = nullptr;
  rc = cmdAPIFunc(name, func, nullptr, &reply, capture);
  if (rc != 0) {
    std::free(reply);
    copyCapture(result, capture);
    return done(klpMapCmdRc(rc));
  }
  size_t len = 0;
  const char* payload = replyPayload(reply, &len);
  auto convert = [&](char* out, size_t outLen, int32_t* required) {
    if (kind == KLP_KIND_KCAP) return klpStatusFromKcap(payload, len, out, outLen, required);
    if (kind == KLP_KIND_KAPP) return klpStatusFromKapp(payload, len, out, outLen, required);
    return klpStatusFromThreads(payload, len, out, outLen, required);
  };

  int32_t required = 0;
  rc = convert(nullptr, 0, &required);
  if (rc == KLP_API_BAD_REPLY) {
    internalError(capture, "klpGetStatus", rc, "status data",
                  "the reply holds less than its counts and offsets claim");
    std::free(reply);
    copyCapture(result, capture);
    return done(rc);
  }
  request->requiredSize = required;
  if (request->bufferSize == 0) {
    void* buf = std::calloc(1, static_cast<size_t>(required));
    if (!buf) {
      std::free(reply);
      return done(KLP_API_ALLOC_FAILED);
    }
    request->buffer = buf;
    request->bufferSize = required;
  }
  size_t outLen = request->bufferSize > 0 ? static_cast<size_t>(request->bufferSize) : 0;
  rc = convert(static_cast<char*>(request->buffer), request->buffer ? outLen : 0, &required);
  std::free(reply);
  return done(rc);
}
