#include "common/ipc/cmdsengine.h"

#include <cctype>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "common/env/klpenv.h"
#include "common/ipc/ipcmsg.h"
#include "common/msg/klplog.h"
#include "common/msg/msglogger.h"
#include "common/parms/klpparm.h"
#include "common/platform/hsv.h"
#include "common/thread/klpthread.h"
#include "common/thread/ordlist.h"
#include "common/thread/recoverymgr.h"
#include "common/trace/trace.h"
#include "common/trace/trace_anchor.h"
#include "common/util/klprc.h"

namespace {

// Trace rows of the command engine: common functions (component 11).
constexpr int kTrcComp = 11;
enum : int {
  kFnEngine = 41,
  kFnHandle = 42,
  kFnReply = 43,
  kFnStop = 44,
  kFnDbCheck = 45,
};

constexpr const char* kOrigin = "cmdsEngine";

// Parameters of an "xqapply" program that decide what "no critical thread"
// means (its AUTOSTOP-like flag and its stop-point text), and the flag a
// server uses for the same in one-pass mode.
constexpr int kParmApplyFlag = 18;
constexpr int kParmApplyText = 34;
constexpr int kParmServerTerm = 5;

cmdsDbStatusFn g_dbCheck = nullptr;

int64_t nowSeconds() { return hsvTimeGetUTC().seconds; }

bool startsWith(const char* s, const char* prefix) {
  return s != nullptr && strncmp(s, prefix, strlen(prefix)) == 0;
}

const char* programName() {
  const char* n = getEnvProgramName(klpGetEnv());
  return n != nullptr ? n : "";
}

const char* namePrefix() { return getEnvNamePrefix(klpGetEnv()); }

// Server name (parameter 0) of the current parameter object, for messages.
const char* serverName() {
  klpParmClass* p = klpGetCurrentParms();
  const ParmEntry* s = p != nullptr ? p->peekSlot(0) : nullptr;
  if (s == nullptr || s->type != PARM_STRING || s->strValue == nullptr) return "*";
  return s->strValue;
}

bool parmFlag(klpParmClass* p, int index) {
  const ParmEntry* s = p != nullptr ? p->peekSlot(index) : nullptr;
  return s != nullptr && s->type == PARM_BOOLEAN && s->boolValue != 0;
}

bool parmTextSet(klpParmClass* p, int index) {
  const ParmEntry* s = p != nullptr ? p->peekSlot(index) : nullptr;
  return s != nullptr && s->type == PARM_STRING && s->strValue != nullptr &&
         s->strValue[0] != '\0';
}

void msgInt(char* buf, size_t len, long long v) { snprintf(buf, len, "%lld", v); }

// ---------------------------------------------------------------------------
// Failed gets
// ---------------------------------------------------------------------------
void noteGetFailure(cmdsState* st, const char* detail) {
  if (st->getFailed) return;  // reported once until a get succeeds again
  st->getFailed = 1;
  logKlpMsg(525, kOrigin, KLP_DEST_SEVERITY, getEnvIpcQRcvName(klpGetEnv()), nullptr, 0);
  logInternalError(kOrigin, KLP_RC_GET_FAILED, "HSVHIPCQueue::get", detail);
}

void noteGetSuccess(cmdsState* st) {
  if (!st->getFailed) return;
  st->getFailed = 0;
  logKlpMsg(517, kOrigin, KLP_DEST_SEVERITY, getEnvIpcQRcvName(klpGetEnv()), nullptr, 0);
}

// ---------------------------------------------------------------------------
// Distribution to the threads
// ---------------------------------------------------------------------------
OrdList* cmdListOf(klpThread* t) { return t->cmdList != nullptr ? t->cmdList : t->sharedCmdList; }

// Commands waiting on the list. Only the engine adds to it, so the count can
// only fall between this look and the engine's own put.
int32_t pendingCmds(OrdList* list) {
  int lrc = list->lockList();
  int32_t n = list->count;
  if (lrc == 0) list->unlockList();
  return n;
}

// A thread that does not take its commands must not make its list grow
// without end: a request past the cap is refused for that thread.
bool underCap(klpThread* t, OrdList* target, const IpcMsgView& view) {
  int32_t waiting = pendingCmds(target);
  if (waiting < CMDS_MAX_PENDING_CMDS) return true;
  char num[16], func[16];
  msgInt(num, sizeof num, waiting);
  msgInt(func, sizeof func, view.header.func);
  logKlpMsg(CMDS_MSG_CMD_REFUSED, kOrigin, KLP_DEST_SEVERITY, t->name, nullptr, 2, num, func);
  return false;
}

int distribute(cmdsState* st, OrdList* threads, const IpcMsgView& view) {
  if (threads == nullptr) return 0;
  int rc = 0;
  int lrc = threads->lockList();
  if (lrc != 0) logInternalError(kOrigin, lrc, "OrdList::lock");
  for (OrdListElement* e = threads->browseHead(); e != nullptr; e = OrdList::browsePrev(e)) {
    klpThread* t = klpThreadOf(e);
    if (!interestedInCmd(t, view.header.func)) continue;
    OrdList* target = cmdListOf(t);
    if (target == nullptr || !underCap(t, target, view)) continue;
    MsgQe* qe = nullptr;
    if (createMsgQe(&qe, view) != 0 || qe == nullptr) {
      st->endRequested = 1;
      rc = KLP_RC_NO_MEMORY;
      break;
    }
    target->putTail(&qe->ole);
  }
  if (lrc == 0) {
    int urc = threads->unlockList();
    if (urc != 0) logInternalError(kOrigin, urc, "OrdList::unlock");
  }
  return rc;
}

// ---------------------------------------------------------------------------
// CHGPARMS
// ---------------------------------------------------------------------------
// True when text is a whole decimal number within int32 (an optional sign,
// then digits only).
bool wholeDecimal(const char* text, int32_t* out) {
  const char* p = text;
  if (*p == '+' || *p == '-') ++p;
  if (*p == '\0') return false;
  for (const char* q = p; *q != '\0'; ++q)
    if (!isdigit(static_cast<unsigned char>(*q))) return false;
  errno = 0;
  char* end = nullptr;
  long long v = strtoll(text, &end, 10);
  if (errno != 0 || *end != '\0' || v < INT32_MIN || v > INT32_MAX) return false;
  *out = static_cast<int32_t>(v);
  return true;
}

void changeParm(int32_t index, const char* value) {
  klpParmClass* parms = klpGetCurrentParms();
  if (parms == nullptr) return;
  const ParmEntry* slot = parms->peekSlot(index);
  // Only what the server declared changeable while it runs may change: the
  // request can come from any local process, not only the command program.
  if (slot == nullptr || slot->index < 0 || !slot->changeable) return;
  switch (slot->type) {
    case PARM_BOOLEAN: {
      char up[8];
      size_t n = strlen(value);
      if (n >= sizeof up) return;
      for (size_t i = 0; i <= n; ++i) up[i] = static_cast<char>(toupper(static_cast<unsigned char>(value[i])));
      int32_t v;
      if (strcmp(up, "Y") == 0 || strcmp(up, "YES") == 0)
        v = 1;
      else if (strcmp(up, "N") == 0 || strcmp(up, "NO") == 0)
        v = 0;
      else
        return;
      if (v == 1 && index == kParmApplyFlag && startsWith(programName(), "xqapply") &&
          parmTextSet(parms, kParmApplyText)) {
        logKlpMsg(9011, kOrigin, KLP_DEST_SEVERITY, " ", nullptr, 0);
        return;
      }
      parms->setParmBool(index, v, PARM_SRC_CHGPARMS);
      break;
    }
    case PARM_INTEGER: {
      int32_t v;
      if (wholeDecimal(value, &v)) parms->setParm(index, v, PARM_SRC_CHGPARMS);
      break;
    }
    case PARM_STRING:
      parms->setParm(index, value, PARM_SRC_CHGPARMS);
      break;
    default:
      break;
  }
}

// ---------------------------------------------------------------------------
// Replies
// ---------------------------------------------------------------------------
int buildQueryReply(IpcMsg** out, int32_t pid) {
  klpParmClass* parms = klpGetCurrentParms();
  int qrc = KLP_RC_BAD_PARM;
  if (parms != nullptr) {
    size_t qsize = parms->getQueryMsgSize();
    // Every requester refuses a longer one; a registry's slots cannot make it.
    qrc = qsize <= ipcReplyPayloadLimit(IPC_FUNC_QRYPARMS) ? KLP_OK : KLP_RC_TOO_LONG;
    if (qrc == KLP_OK) {
      int rc = createReplyMsg(out, IPC_HEADER_SIZE + qsize, IPC_FUNC_QRYPARMS, pid);
      if (rc != 0) return rc;
      qrc = parms->setQueryMsg((*out)->payload());
      if (qrc == KLP_OK) return 0;
      freeIpcMsg(*out);
      *out = nullptr;
    }
  }
  logInternalError(kOrigin, qrc, "setQueryMsg");
  // An empty query message still answers, so the requester does not wait
  // for a reply that never comes.
  int rc = createReplyMsg(out, IPC_HEADER_SIZE + KLP_QUERY_HEADER_SIZE, IPC_FUNC_QRYPARMS, pid);
  if (rc != 0) return rc;
  memcpy((*out)->payload() + 2, "KLPQRYMG", 8);
  return 0;
}

int buildChgparmsReply(IpcMsg** out, const void* buf, size_t received, int32_t pid) {
  int rc = createReplyMsg(out, received, IPC_FUNC_CHGPARMS, pid);
  if (rc != 0) return rc;
  memcpy(*out, buf, received);
  (*out)->msgLength = static_cast<int32_t>(received);
  (*out)->senderPid = pid;
  return 0;
}

int buildSizeReply(IpcMsg** out, OrdList* threads, int32_t pid) {
  int rc = createReplyMsg(out, IPC_SISIZE_MSG_LENGTH, IPC_FUNC_STATUS_SIZE, pid);
  if (rc != 0) return rc;
  char* p = (*out)->payload();
  memcpy(p, IPC_SISIZE_TEXT, IPC_SISIZE_TEXT_SIZE);
  int32_t count = threads != nullptr ? static_cast<uint16_t>(threads->count) : 0;
  memcpy(p + IPC_SISIZE_TEXT_SIZE, &count, sizeof count);
  return 0;
}

// Puts the reply on the requester's reply queue, in pieces when it is long.
// A reply that cannot be delivered is reported and dropped.
void sendReply(IpcMsg* reply, int32_t requester) {
  trcEntry(kTrcComp, kFnReply);
  char path[2 * KLP_ENV_PATH_MAX];
  if (ipcEnvReplyQueuePath(path, sizeof path, requester) != 0) {
    logKlpMsg(597, kOrigin, KLP_DEST_SEVERITY, IPC_RESID_UNKNOWN, nullptr, 2, "*",
              ecfErrorGetDescription(ECF_INVALID_ARGUMENT));
    logKlpMsg(506, kOrigin, KLP_DEST_SEVERITY, ipcProgramCmdWord(namePrefix()), nullptr, 0);
    trcExitRc(kTrcComp, kFnReply, 597);
    return;
  }
  HSVResID id;
  hsvRC prc = hsvIPCGetQueResID(path, HSV_QUEUE_RESID_OPTION, &id);
  char* idText = nullptr;
  HSVHIPCQueue q;
  if (prc == ECF_OK) {
    idText = ipcNewResIDText(&id);
    prc = q.attach(id);
  }
  if (prc != ECF_OK) {
    logKlpMsg(597, kOrigin, KLP_DEST_SEVERITY, idText != nullptr ? idText : IPC_RESID_UNKNOWN,
              nullptr, 2, path, ecfErrorGetDescription(prc));
    logKlpMsg(506, kOrigin, KLP_DEST_SEVERITY, ipcProgramCmdWord(namePrefix()), nullptr, 0);
    free(idText);
    trcExitRc(kTrcComp, kFnReply, 597);
    return;
  }
  // A requester that does not take its replies must not hold up everyone
  // else's: the first message goes only when there is room for it now.
  hsvRC putRc = ECF_OK;
  if (putIpcReply(&q, reply, 0, CMDS_PIECE_WAIT_MS, &putRc, kOrigin) == IPC_RC_PUT_FAILED) {
    logKlpMsg(508, kOrigin, KLP_DEST_SEVERITY, idText != nullptr ? idText : IPC_RESID_UNKNOWN,
              nullptr, 0);
    logInternalError(kOrigin, KLP_RC_PUT_FAILED, "HSVHIPCQueue::put",
                     ecfErrorGetDescription(putRc));
  }
  q.detach();
  free(idText);
  trcExitRc(kTrcComp, kFnReply, 0);
}

}  // namespace

// ---------------------------------------------------------------------------
// STATUS reply
// ---------------------------------------------------------------------------
int recState(OrdList* threads, IpcMsg** out) {
  *out = nullptr;
  int lrc = threads != nullptr ? threads->lockList() : -1;
  int32_t n = threads != nullptr ? threads->count : 0;
  if (n < 0) n = 0;
  size_t size = IPC_HEADER_SIZE + IPC_STATUS_HEADER + IPC_STATUS_RECORD * (static_cast<size_t>(n) + 1);
  int rc = createReplyMsg(out, size, IPC_FUNC_STATUS, hsvProcessID());
  if (rc == 0 && threads != nullptr) {
    char* p = (*out)->payload();
    char* rec = p + IPC_STATUS_HEADER;
    int32_t filled = 0;
    for (OrdListElement* e = threads->browseHead(); e != nullptr && filled < n;
         e = OrdList::browsePrev(e)) {
      klpThread* t = klpThreadOf(e);
      memset(rec, 0, IPC_STATUS_RECORD);
      snprintf(rec, IPC_STATUS_NAME, "%.14s", t->name);
      int32_t state = t->getState();
      memcpy(rec + IPC_STATUS_NAME, &state, sizeof state);
      rec += IPC_STATUS_RECORD;
      ++filled;
    }
    memcpy(p + 8, &filled, sizeof filled);
  }
  if (lrc == 0) threads->unlockList();
  return rc;
}

// ---------------------------------------------------------------------------
// Database status
// ---------------------------------------------------------------------------
void cmdsSetDbStatusCheck(cmdsDbStatusFn fn) { g_dbCheck = fn; }

int cmdsCheckDbStatus(int mode, char* statusText, size_t len) {
  trcEntry(kTrcComp, kFnDbCheck);
  if (startsWith(programName(), "apply") && mode == CMDS_MODE_NORMAL) return 0;
  if (g_dbCheck != nullptr) {
    if (len > 0) statusText[0] = '\0';
    int rc = g_dbCheck(statusText, len);
    if (len > 0) statusText[len - 1] = '\0';
    return rc;
  }
  klpThread* t = currentThread();
  klpDbConn* conn = t != nullptr ? t->getCurDbConn() : nullptr;
  if (conn == nullptr && t != nullptr) conn = t->conns;  // the thread-control connection
  if (conn == nullptr) {
    logInternalError("checkDBStatus", KLP_RC_TOO_LONG, "findDbConn");
    return KLP_RC_TOO_LONG;
  }
  if (!conn->isOpen && t->connect(conn->kind, conn->dbName, conn->codePage) == nullptr) {
    snprintf(statusText, len, "%s", "UNAVAILABLE");
    return CMDS_RC_DB_UNAVAILABLE;
  }
  snprintf(statusText, len, "%s", "AVAILABLE");
  return 0;
}

// ---------------------------------------------------------------------------
// The engine
// ---------------------------------------------------------------------------
void cmdsInitState(cmdsState* st, int mode, int32_t* stopRequested) {
  memset(st, 0, sizeof *st);
  st->mode = mode;
  st->stopRequested = stopRequested;
  st->grace = startsWith(programName(), "xqapply") ? CMDS_GRACE_SECONDS_XQAPPLY : CMDS_GRACE_SECONDS;
  st->lastCheck = nowSeconds();
  snprintf(st->statusText, sizeof st->statusText, "%s", CMDS_STATUS_UNDETERMINED);
}

int cmdsStartStop(cmdsState* st, OrdList* threads) {
  if (st->stopping) return 0;
  trcEntry(kTrcComp, kFnStop);
  st->stopTime = nowSeconds();
  st->stopping = 1;
  if (threads == nullptr) return 0;
  int rc = 0;
  int lrc = threads->lockList();
  if (lrc != 0) logInternalError(kOrigin, lrc, "OrdList::lock");
  for (OrdListElement* e = threads->browseHead(); e != nullptr; e = OrdList::browsePrev(e)) {
    klpThread* t = klpThreadOf(e);
    if (t->getState() == KLP_THREAD_STOP) continue;
    OrdList* target = cmdListOf(t);
    if (target == nullptr) continue;
    MsgQe* qe = createMsgQeFunc(IPC_FUNC_STOP);
    if (qe == nullptr) {
      st->endRequested = 1;
      rc = KLP_RC_NO_MEMORY;
      break;
    }
    target->putTail(&qe->ole);
  }
  if (lrc == 0) {
    int urc = threads->unlockList();
    if (urc != 0) {
      logInternalError(kOrigin, urc, "OrdList::unlock");
      rc = CMDS_RC_UNLOCK_FAILED;
    }
  }
  trcExitRc(kTrcComp, kFnStop, rc);
  return rc;
}

int cmdsHandleMessage(cmdsState* st, OrdList* threads, const void* buf, size_t received) {
  trcEntry(kTrcComp, kFnHandle);
  IpcMsgView view;
  int drc = buf != nullptr ? ipcDecodeMsg(buf, received, &view) : KLP_RC_GET_FAILED;
  if (drc != 0 && drc != KLP_RC_BAD_VERSION) {
    char detail[96];
    snprintf(detail, sizeof detail, "a message of %zu bytes is not a command message", received);
    noteGetFailure(st, detail);
    return 0;
  }
  noteGetSuccess(st);
  trcData(kTrcComp, kFnHandle, "Got IPC Message", 4, 0, static_cast<uint32_t>(IPC_HEADER_SIZE),
          &view.header);
  char num[24];
  if (drc == KLP_RC_BAD_VERSION) {
    msgInt(num, sizeof num, view.header.msgVersion);
    logKlpMsg(509, kOrigin, KLP_DEST_SEVERITY, num, nullptr, 0);
    return 0;
  }
  const IpcMsg& h = view.header;
  if (h.func == 0) {
    msgInt(num, sizeof num, h.senderPid);
    logKlpMsg(511, kOrigin, KLP_DEST_SEVERITY, num, nullptr, 0);
    return 0;
  }

  int rc = distribute(st, threads, view);  // an allocation failure was reported (543)
  if (rc != 0) return rc;
  st->requester = h.senderPid;
  if (h.senderPid == 0) return 0;

  const int32_t pid = hsvProcessID();
  IpcMsg* reply = nullptr;
  switch (h.func) {
    case IPC_FUNC_TRCSTART: {
      klpEnv* env = klpGetEnv();
      const char* prefix = namePrefix();
      trcAttach(getEnvIPCDir(env), prefix != nullptr ? prefix : "", &env->appVersion,
                env->moduleList);
      if (h.subFunc == 0) createReplyMsg(&reply, IPC_HEADER_SIZE, h.func, pid);
      break;
    }
    case IPC_FUNC_STOP:
      createReplyMsg(&reply, IPC_HEADER_SIZE, h.func, pid);
      if (!st->stopping) {
        st->stopping = 1;
        st->stopTime = nowSeconds();
        if (st->stopRequested != nullptr) *st->stopRequested = 1;
      }
      logKlpMsg(522, kOrigin, KLP_DEST_LOG, ipcFuncWord(h.func), nullptr, 0);
      break;
    case IPC_FUNC_STATUS: {
      int src = recState(threads, &reply);
      if (src != 0) logInternalError(kOrigin, src, "recState");
      break;
    }
    case IPC_FUNC_QRYPARMS:
      buildQueryReply(&reply, pid);
      break;
    case IPC_FUNC_CHGPARMS: {
      char value[MSGQE_STRING_SIZE];
      ipcPayloadText(view, value, sizeof value);
      changeParm(h.subFunc, value);
      buildChgparmsReply(&reply, buf, received, pid);
      break;
    }
    case IPC_FUNC_STATUS_SIZE:
      buildSizeReply(&reply, threads, pid);
      break;
    case IPC_FUNC_KCAP_DETAILS:
    case IPC_FUNC_KAPP_DETAILS:
    case IPC_FUNC_KAPP_SIZE:
      break;  // the interested thread answers
    default:
      createReplyMsg(&reply, IPC_HEADER_SIZE, h.func, pid);
      break;
  }
  if (reply != nullptr) {
    sendReply(reply, h.senderPid);
    freeIpcMsg(reply);
  }
  trcExitRc(kTrcComp, kFnHandle, 0);
  return 0;
}

namespace {

// Step 2 of the loop: nothing to take. Lets an asynchronous logger write its
// queued records and waits until the clock has moved on by a second, or
// until a request arrives, whichever comes first.
void idleStep(HSVHIPCQueue* q) {
  HSVTimeUTC start = hsvTimeGetUTC();
  msgLogger* logger = klpGetProcessLogger();
  for (;;) {
    if (logger != nullptr && logger->isAsynchronous()) {
      while (logger->serveQueuedMsg(0) > 0) {
      }
    }
    HSVTimeUTC now = hsvTimeGetUTC();
    if (now.seconds > start.seconds) return;
    int32_t left = (1000000 - now.microseconds) / 1000 + 1;
    if (left > 100) left = 100;
    if (q->waitForMessage(left) == ECF_OK) return;
  }
}

// Step 11: 415 (no critical thread alive) starts the stop sequence by the
// program's own rule.
bool noCriticalStops(int mode) {
  klpParmClass* p = klpGetCurrentParms();
  if (startsWith(programName(), "xqapply")) {
    bool want = parmTextSet(p, kParmApplyText) || parmFlag(p, kParmApplyFlag);
    if (!want) return false;
    return !(mode == CMDS_MODE_ONE_PASS && !parmFlag(p, kParmServerTerm));
  }
  return !(mode == CMDS_MODE_ONE_PASS && !parmFlag(p, kParmServerTerm));
}

}  // namespace

int cmdsEngine(OrdList* threads, int mode, int32_t* stopRequested) {
  trcEntry(kTrcComp, kFnEngine);
  klpEnv* env = klpGetEnv();
  HSVHIPCQueue* q = getEnvIpcQRcvHdl(env);
  if (q == nullptr) {
    logInternalError(kOrigin, KLP_RC_QUEUE_UNAVAILABLE, "getEnvIpcQRcvHdl");
    trcExitRc(kTrcComp, kFnEngine, KLP_RC_QUEUE_UNAVAILABLE);
    return KLP_RC_QUEUE_UNAVAILABLE;
  }
  cmdsState st;
  cmdsInitState(&st, mode, stopRequested);
  char buf[IPC_MAX_MSG_SIZE];
  int loopRc = 0;

  for (;;) {
    trcCheckStop();  // 1
    if (!q->hasMessage()) {
      idleStep(q);  // 2
    } else {
      size_t got = 0;  // 3
      hsvRC grc = q->get(buf, sizeof buf, &got, CMDS_GET_TIMEOUT_MS);
      if (grc != ECF_OK) {
        noteGetFailure(&st, ecfErrorGetDescription(grc));
        // The message is still there: without a pause the loop would spin.
        HSVTimeUTC now = hsvTimeGetUTC();
        hsvSleep(static_cast<uint32_t>((1000000 - now.microseconds) / 1000 + 1));
      } else {
        int hrc = cmdsHandleMessage(&st, threads, buf, got);  // 4-8
        if (hrc != 0 && st.endRc == 0) st.endRc = hrc;
      }
    }

    // 9: database status, every few seconds.
    if (!st.stopping && nowSeconds() - st.lastCheck > CMDS_DB_CHECK_SECONDS) {
      st.lastCheck = nowSeconds();
      char text[CMDS_STATUS_TEXT_SIZE];
      int drc = cmdsCheckDbStatus(mode, text, sizeof text);
      if (drc == CMDS_RC_DB_NOT_READY || drc == CMDS_RC_DB_QUIESCED ||
          drc == CMDS_RC_DB_UNAVAILABLE) {
        st.dbDown = 1;
        if (mode == CMDS_MODE_NORMAL) loopRc = CMDS_RC_DB_DOWN;
      }
    }

    // 10: a signal the recovery manager recorded.
    if (!st.stopping && erGetGlobalSignal() != 0) {
      char text[256];
      msgLogger* logger = klpGetProcessLogger();
      snprintf(text, sizeof text,
               "A global signal was received by \"%s\". Stop cmdsEngine(), stop all threads and exit.",
               logger != nullptr ? logger->getApplicationName() : programName());
      logKlpMsg(-1, kOrigin, KLP_DEST_SEVERITY, text, nullptr, 0);
      erClearGlobalSignal();
      st.signalSeen = 1;
      int src = cmdsStartStop(&st, threads);
      if (src != 0 && st.endRc == 0) st.endRc = src;
    }

    // 11: supervision.
    if (loopRc != 0) {
      int src = cmdsStartStop(&st, threads);
      if (src != 0 && st.endRc == 0) st.endRc = src;
      loopRc = 0;
    } else {
      int src = supervise(threads, st.stopping, &st.highestEndCode);
      if (src == KLP_RC_NONE_ALIVE) {
        st.endRequested = 1;
      } else if (src == KLP_RC_NO_CRITICAL) {
        if (noCriticalStops(mode)) {
          int s2 = cmdsStartStop(&st, threads);
          if (s2 != 0 && st.endRc == 0) st.endRc = s2;
        }
      } else if (src != 0) {
        int s2 = cmdsStartStop(&st, threads);
        if (s2 != 0 && st.endRc == 0) st.endRc = s2;
      }
    }

    // 13: the stop sequence's grace.
    if (st.stopping) {
      bool check = true;
      if (startsWith(programName(), "apply")) {
        int ws = threadStateByName(threads, "WorkerThread");
        check = ws == KLP_THREAD_REST || ws == KLP_THREAD_DBWAIT;
      }
      if (check && nowSeconds() - st.stopTime > st.grace) break;
    }
    // 14
    if (st.endRequested || mode == CMDS_MODE_ONE_PASS) break;
  }

  // End: the final database status check.
  int result;
  int frc = cmdsCheckDbStatus(mode, st.statusText, sizeof st.statusText);
  if (frc == CMDS_RC_DB_NOT_READY || frc == CMDS_RC_DB_QUIESCED ||
      frc == CMDS_RC_DB_UNAVAILABLE || env->dbUnavailable || st.dbDown) {
    result = CMDS_RC_DB_UNAVAILABLE;
    if (mode == CMDS_MODE_NORMAL)
      logKlpMsg(534, kOrigin, KLP_DEST_SEVERITY, serverName(), nullptr, 1, st.statusText);
  } else if (st.endRc != 0) {
    result = st.endRc;
  } else {
    result = st.highestEndCode == KLP_RC_THREAD_ENDED ? 0 : st.highestEndCode;
  }
  if (st.highestEndCode == CMDS_RC_RRS_UNAVAILABLE)
    logKlpMsg(534, kOrigin, KLP_DEST_SEVERITY, serverName(), nullptr, 1, "RRS NOT AVAILABLE");
  if (mode == CMDS_MODE_NORMAL) {
    delEnvIpcQRcvHdl(env);
    klpEnvClear(env);
  }
  trcExitRc(kTrcComp, kFnEngine, result);
  return result;
}
