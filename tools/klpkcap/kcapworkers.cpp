#include "tools/klpkcap/kcapworkers.h"

#include <unistd.h>

#include <climits>
#include <cstdio>
#include <cstring>
#include <ctime>

#include "common/env/klpenv.h"
#include "common/ipc/kcapdetails.h"
#include "common/ipc/cmdapi.h"
#include "common/ipc/ipcmsg.h"
#include "common/msg/klplog.h"
#include "common/msg/msglogger.h"
#include "common/platform/hsv.h"
#include "common/thread/klpthread.h"
#include "common/thread/recoverymgr.h"
#include "common/util/klprc.h"

namespace {

// How often a resting thread looks at its command list.
constexpr uint32_t kPollMs = 20;

// Payload placement of the detailed status.
using namespace kcapDetails;
constexpr size_t kLogFileAt = kMinSize;  // the log file name follows the fixed part
constexpr size_t kLogFileMax = 1027;  // the status data's field holds 1027 and a NUL

struct WorkerRole {
  const char* name;
  int critical;
  int takesSuspend;  // SUSPEND / RESUME change its state
  int extra[6];      // further function codes it wants, 0-ended
};

// AdminThread keeps answering while the others are suspended, so it ignores
// SUSPEND and RESUME and stays the critical thread that keeps the set
// working.
const WorkerRole kWorkers[] = {
    {"AdminThread", 1, 0, {IPC_FUNC_KCAP_DETAILS, IPC_FUNC_REINITQ, IPC_FUNC_STARTQ, IPC_FUNC_STOPQ, 0}},
    {"WorkerThread", 1, 1, {IPC_FUNC_REINIT, 0}},
    {"PruneThread", 0, 1, {IPC_FUNC_PRUNE, 0}},
    {"HoldLThread", 0, 1, {0}},
};

void put16(char* p, size_t at, uint16_t v) { memcpy(p + at, &v, sizeof v); }
void put32(char* p, size_t at, int32_t v) { memcpy(p + at, &v, sizeof v); }

void logText(const char* origin, const char* fmt, const char* a, const char* b) {
  char text[1200];
  snprintf(text, sizeof text, fmt, a, b);
  logKlpMsg(-1, origin, KLP_DEST_LOG, text, nullptr, 0);
}

void answerDetails(klpThread* t, const MsgQe* qe) {
  klpEnv* env = klpGetEnv();
  msgLogger* logger = klpGetProcessLogger();
  int64_t up = hsvTimeGetUTC().seconds - env->startTime;
  IpcMsg* reply = kcapDetailsReply(up, logger != nullptr ? logger->getLogFileName() : "",
                                   kcapResidentBytes());
  if (reply == nullptr) return;
  int rc = KLPResponseFunc(qe->QeResponseId, reply);
  if (rc != 0) {
    char code[16];
    snprintf(code, sizeof code, "%d", rc);
    logText(t->name, "%s could not answer the detailed status request: %s", t->name, code);
  }
  freeIpcMsg(reply);
}

// Carries out one command element. Answers false when the thread must end.
bool handle(klpThread* t, const WorkerRole& role, const MsgQe* qe) {
  const char* queueName = qe->QeString[0] != '\0' ? qe->QeString : "ALL";
  switch (qe->QeFunc) {
    case IPC_FUNC_STOP:
      return false;
    case IPC_FUNC_SUSPEND:
      if (role.takesSuspend) {
        t->setState(KLP_THREAD_WAIT);
        logText(t->name, "%s is suspended%s.", t->name, "");
      }
      break;
    case IPC_FUNC_RESUME:
      if (role.takesSuspend) {
        t->setState(KLP_THREAD_REST);
        logText(t->name, "%s resumed its work%s.", t->name, "");
      }
      break;
    case IPC_FUNC_PRUNE:
      logText(t->name, "%s pruned the control tables%s.", t->name, "");
      break;
    case IPC_FUNC_REINIT:
      logText(t->name, "%s reinitialized all subscriptions%s.", t->name, "");
      break;
    case IPC_FUNC_REINITQ:
      logText(t->name, "%s reinitialized the send queue \"%s\".", t->name, queueName);
      break;
    case IPC_FUNC_STARTQ:
      logText(t->name, "%s started the send queue \"%s\".", t->name, queueName);
      break;
    case IPC_FUNC_STOPQ:
      logText(t->name, "%s stopped the send queue \"%s\".", t->name, queueName);
      break;
    case IPC_FUNC_KCAP_DETAILS:
      answerDetails(t, qe);
      break;
    default:
      break;
  }
  return true;
}

const WorkerRole* roleOf(const klpThread* t) {
  for (const WorkerRole& s : kWorkers)
    if (strcmp(s.name, t->name) == 0) return &s;
  return nullptr;
}

void workerBody(klpThread* t) {
  int rc = klpThread::prologue(t);
  if (rc != 0) threadEnd(t, rc);
  if (KLP_SET_RECOVERY_POINT(t->rcvyMgr) != 0) {
    rc = recoveryMgr::erRecover(&t->rcvyMgr, t);
    threadEnd(t, rc);
  }
  const WorkerRole* role = roleOf(t);
  if (role == nullptr) threadEnd(t, KLP_RC_BAD_PARM);
  t->setState(KLP_THREAD_REST);
  OrdList* list = t->cmdList != nullptr ? t->cmdList : t->sharedCmdList;
  for (;;) {
    OrdListElement* e = list != nullptr ? list->getHead() : nullptr;
    if (e == nullptr) {
      hsvSleep(kPollMs);
      continue;
    }
    MsgQe* qe = reinterpret_cast<MsgQe*>(e);
    bool goOn = handle(t, *role, qe);
    deleteMsgQe(qe);
    if (!goOn) break;
  }
  threadEnd(t, 0);
}

}  // namespace

int kcapStartWorkers(OrdList* threads) {
  for (const WorkerRole& s : kWorkers) {
    int code = 0;
    klpThread* t = createThread(&code, threads, workerBody, s.name, nullptr, 1, nullptr, 0,
                                s.critical);
    if (t == nullptr || code != 0) return code != 0 ? code : KLP_RC_NO_MEMORY;
    if (!s.takesSuspend) {
      setCmdInterest(t, IPC_FUNC_SUSPEND, 0);
      setCmdInterest(t, IPC_FUNC_RESUME, 0);
    }
    for (int f : s.extra) {
      if (f == 0) break;
      setCmdInterest(t, f, 1);
    }
  }
  return 0;
}

IpcMsg* kcapDetailsReply(int64_t upTime, const char* logFile, int32_t memoryBytes) {
  size_t nameLen = logFile != nullptr ? strnlen(logFile, kLogFileMax) : 0;
  IpcMsg* reply = nullptr;
  if (createReplyMsg(&reply, IPC_HEADER_SIZE + kLogFileAt + 2 + nameLen, IPC_FUNC_KCAP_DETAILS,
                     hsvProcessID()) != 0)
    return nullptr;
  char* p = reply->payload();
  put32(p, kUpTime, upTime < 0 ? 0 : upTime > INT32_MAX ? INT32_MAX : static_cast<int32_t>(upTime));
  put16(p, kLogFileRef, static_cast<uint16_t>(kLogFileAt));
  put32(p, kActiveSubs, 0);  // the sample publishes no subscriptions

  HSVTimeUTC now = hsvTimeGetUTC();
  struct tm lt;
  char stamp[64] = "";
  if (hsvTimeLocalTime(now.seconds, &lt)) {
    char base[32];
    strftime(base, sizeof base, "%Y-%m-%d-%H.%M.%S", &lt);
    snprintf(stamp, sizeof stamp, "%s.%06d", base, static_cast<int>(now.microseconds));
  }
  memcpy(p + kLogTime, stamp, strnlen(stamp, kLogTimeLen));
  memset(p + kLsn, 0, kLsnLen);  // nothing published yet
  put32(p, kMemory, memoryBytes);
  put16(p, kSectionRef, 0);
  put16(p, kLogFileAt, static_cast<uint16_t>(nameLen));
  if (nameLen > 0) memcpy(p + kLogFileAt + 2, logFile, nameLen);
  return reply;
}

int32_t kcapResidentBytes() {
  FILE* f = fopen("/proc/self/statm", "r");
  if (f == nullptr) return 0;
  unsigned long long size = 0, resident = 0;
  int n = fscanf(f, "%llu %llu", &size, &resident);
  fclose(f);
  if (n != 2) return 0;
  long page = sysconf(_SC_PAGESIZE);
  unsigned long long bytes = resident * static_cast<unsigned long long>(page > 0 ? page : 4096);
  return bytes > INT32_MAX ? INT32_MAX : static_cast<int32_t>(bytes);
}

int kcapDbStatus(char* statusText, size_t len) {
  if (len > 0) snprintf(statusText, len, "%s", "AVAILABLE");
  return 0;
}
