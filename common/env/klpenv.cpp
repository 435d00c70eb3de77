// The process environment record and the server's receiving queue.
#include "common/env/klpenv.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <new>

#include "common/ipc/ipcmsg.h"
#include "common/msg/klplog.h"
#include "common/msg/msglogger.h"
#include "common/parms/klpparm.h"
#include "common/thread/recoverymgr.h"
#include "common/util/klprc.h"

namespace {

constexpr const char* kOriginSetQueue = "Klpenv:setEnvIpcQRcvHdl";
constexpr const char* kOriginDelQueue = "Klpenv:delEnvIpcQRcvHdl";
constexpr const char* kNotSet = "[NOT SET]";
constexpr const char* kDefaultIpcDir = "/tmp/";

// The common library's own modules, as the trace shows them. Three rows are
// spare so the table keeps its fixed size as modules come and go.
struct ModuleRow {
  const char* name;
  const char* fixLevel;
};
const ModuleRow kModules[KLP_MODULE_TABLE_COUNT] = {
    {"klpenv.cpp", "K800001"},    {"ipcmsg.cpp", "K800001"},    {"klpfmt.cpp", "K800001"},
    {"klpparm.cpp", "K800001"},   {"klplog.cpp", "K800001"},    {"msglogger.cpp", "K800001"},
    {"msgtext.cpp", "K800001"},   {"ordlist.cpp", "K800001"},   {"klpthread.cpp", "K800001"},
    {"queue.cpp", "K800001"},     {"rcvymgr.cpp", "K800001"},   {"trace.cpp", "K800001"},
    {"trcattach.cpp", "K800001"}, {"trcformat.cpp", "K800001"}, {"cmdapi.cpp", "K800001"},
    {"cmdengine.cpp", "K800001"}, {"quickcell.cpp", "K800001"}, {"convmgr.cpp", "K800001"},
    {nullptr, nullptr},           {nullptr, nullptr},           {nullptr, nullptr},
};

klpEnv g_env;

void copyField(char* dst, size_t size, const char* src) {
  size_t n = src ? strnlen(src, size) : 0;
  memset(dst, 0, size);
  memcpy(dst, src, n);
}

void releaseOwned(klpEnv* env) {
  free(env->moduleList);
  env->moduleList = nullptr;
  free(env->rcvQueueName);
  env->rcvQueueName = nullptr;
}

void clearRecord(klpEnv* env) {
  releaseOwned(env);
  env->rcvQueue = nullptr;
  env->rcvQueueRecovery = nullptr;
  memset(env->instancePath, 0, sizeof env->instancePath);
  memset(env->ipcDir, 0, sizeof env->ipcDir);
  memset(&env->appVersion, ' ', sizeof env->appVersion);
  memcpy(env->appVersion.rel.archLevel, "0801", 4);
  env->startTime = 0;
  memset(env->programName, 0, sizeof env->programName);
  memset(env->jobName, 0, sizeof env->jobName);
  memset(env->programLevel, 0, sizeof env->programLevel);
  env->dbUnavailable = 0;
}

void atProcessEnd() { releaseOwned(&g_env); }

klpEnv* initOnce() {
  clearRecord(&g_env);
  atexit(atProcessEnd);
  return &g_env;
}

void setQueueName(klpEnv* env, const HSVResID* id) {
  free(env->rcvQueueName);
  env->rcvQueueName = ipcNewResIDText(id);
}

const char* queueNameOrNotSet(const klpEnv* env) {
  return env->rcvQueueName ? env->rcvQueueName : kNotSet;
}

}  // namespace

klpEnv* klpGetEnv() {
  static klpEnv* env = initOnce();
  return env;
}

int klpEnvClear(klpEnv* env) {
  if (!env) return KLP_RC_BAD_PARM;
  if (env->rcvQueue) return KLP_RC_BAD_PARM;  // would lose track of a live queue
  clearRecord(env);
  return KLP_OK;
}

void setEnvTovRIB(klpEnv* env, const char* programName, int version, int release,
                  int modification) {
  if (!env) return;
  const char* name = programName ? programName : "";
  env->startTime = hsvTimeGetUTC().seconds;

  klpReleaseBlock& rel = env->appVersion.rel;
  copyField(rel.programName, sizeof rel.programName - 1, name);
  rel.programName[sizeof rel.programName - 1] = '\0';
  copyField(rel.jobName, sizeof rel.jobName, name);
  rel.version = static_cast<int16_t>(version);
  rel.release = static_cast<int16_t>(release);
  rel.modification = static_cast<int16_t>(modification);
  memset(rel.programFixLevel, 0, sizeof rel.programFixLevel);
  memset(rel.baseFixLevel, 0, sizeof rel.baseFixLevel);
  snprintf(env->programName, sizeof env->programName, "%s", name);
  memcpy(env->jobName, rel.jobName, sizeof rel.jobName);
  env->jobName[sizeof rel.jobName] = '\0';

  snprintf(env->programLevel, sizeof env->programLevel, "%s %d.%d.%d", name, version, release,
           modification);

  // The program-level message goes out without the schema in its header;
  // the schema is put back right after.
  klpParmClass* parms = klpGetCurrentParms();
  char* keptSchema = nullptr;
  int32_t keptSource = PARM_SRC_DEFAULT;
  if (parms) {
    const char* schema = parms->getParmString(PARM_IDX_SCHEMA);
    keptSchema = strdup(schema ? schema : "");
    keptSource = parms->getParmSource(PARM_IDX_SCHEMA);
    // The registry refuses a lower source than the value has, so the blank
    // and the restored value are both set with the value's own source.
    parms->setParm(PARM_IDX_SCHEMA, "", keptSource);
  }
  logKlpMsg(600, "setEnvTovRIB", KLP_DEST_CONSOLE, env->programLevel, nullptr, 0);
  if (parms) {
    parms->setParm(PARM_IDX_SCHEMA, keptSchema ? keptSchema : "", keptSource);
    if (msgLogger* logger = klpGetProcessLogger())
      logger->setProgramQualifier(keptSchema ? keptSchema : "");
  }
  free(keptSchema);
}

int klpBuildNamePrefix(char* out, size_t outLen, const char* server, const char* schema,
                       const char* word) {
  if (!out || outLen == 0) return KLP_RC_BAD_PARM;
  out[0] = '\0';
  if (!server || server[0] == '\0') return KLP_RC_NO_SERVER;
  const char* sch = schema ? schema : "";
  size_t schemaLen = strlen(sch);
  if (schemaLen > 0 && sch[schemaLen - 1] == '.') --schemaLen;
  int n = snprintf(out, outLen, "%s.%.*s.%s", server, static_cast<int>(schemaLen), sch,
                   word ? word : "");
  if (n < 0 || static_cast<size_t>(n) >= outLen) {
    // A cut name would address some other server.
    out[0] = '\0';
    return KLP_RC_TOO_LONG;
  }
  return KLP_OK;
}

int setEnvNamePrefix(klpEnv* env, const char* componentWord) {
  if (!env) return KLP_RC_BAD_PARM;
  klpParmClass* parms = klpGetCurrentParms();
  if (!parms) return KLP_RC_NO_SERVER;
  char prefix[KLP_UNIQUE_NAME_SIZE];
  int rc = klpBuildNamePrefix(prefix, sizeof prefix, parms->getParmString(PARM_IDX_SERVER),
                              parms->getParmString(PARM_IDX_SCHEMA), componentWord);
  if (rc != KLP_OK) return rc;
  memset(env->appVersion.rel.uniqueName, 0, KLP_UNIQUE_NAME_SIZE);
  memcpy(env->appVersion.rel.uniqueName, prefix, strlen(prefix));
  return KLP_OK;
}

const char* getEnvIPCDir(klpEnv* env) {
  if (!env) return "";
  // Threads of a server may ask for the first time together.
  static std::mutex fill;
  std::lock_guard<std::mutex> hold(fill);
  if (env->ipcDir[0] == '\0') {
    const char* dir = getenv("TMPDIR");
    // An empty TMPDIR would put everything into the root directory, and one
    // too long for the field cannot be kept whole: both fall back.
    if (!dir || dir[0] == '\0' || strlen(dir) + 2 > sizeof env->ipcDir) dir = kDefaultIpcDir;
    size_t n = strlen(dir);
    memcpy(env->ipcDir, dir, n);
    if (env->ipcDir[n - 1] != '/') env->ipcDir[n++] = '/';
    env->ipcDir[n] = '\0';
  }
  return env->ipcDir;
}

const char* getEnvNamePrefix(klpEnv* env) {
  if (!env) return nullptr;
  const char* u = env->appVersion.rel.uniqueName;
  if (u[0] == ' ' || u[0] == '\0') return nullptr;
  return u;
}

const char* getEnvProgramName(klpEnv* env) { return env ? env->programName : ""; }

const char* getEnvJobName(klpEnv* env) { return env ? env->jobName : ""; }

void setEnvModServ(klpEnv* env, const klpModuleRecord* added, int count) {
  if (!env) return;
  if (count < 0 || (count > 0 && !added)) count = 0;
  // The count travels as 16 bits; more records than that cannot be listed.
  if (count > 0xFFFF - KLP_MODULE_TABLE_COUNT) count = 0xFFFF - KLP_MODULE_TABLE_COUNT;
  size_t size = KLP_MODULE_LIST_BASE + KLP_MODULE_RECORD_SIZE * static_cast<size_t>(count);
  auto* list = static_cast<klpModuleList*>(calloc(1, size));
  if (!list) {
    char sizeText[24];
    snprintf(sizeText, sizeof sizeText, "%d", static_cast<int>(size));
    logKlpMsg(543, "setEnvModServ", KLP_DEST_SEVERITY, sizeText, nullptr, 1, "module list");
    return;
  }
  memcpy(list->eyeCatcher, "KLPSMODL", 9);
  list->count = static_cast<uint16_t>(KLP_MODULE_TABLE_COUNT + count);
  klpModuleRecord* rec = klpModuleRecords(list);
  static const char stamp[] = __DATE__ " " __TIME__;
  for (int i = 0; i < KLP_MODULE_TABLE_COUNT; ++i) {
    if (!kModules[i].name) continue;  // spare rows stay zero
    copyField(rec[i].name, sizeof rec[i].name - 1, kModules[i].name);
    copyField(rec[i].fixLevel, sizeof rec[i].fixLevel - 1, kModules[i].fixLevel);
    copyField(rec[i].compileStamp, sizeof rec[i].compileStamp - 1, stamp);
  }
  if (count > 0)
    memcpy(rec + KLP_MODULE_TABLE_COUNT, added, KLP_MODULE_RECORD_SIZE * static_cast<size_t>(count));
  free(env->moduleList);
  env->moduleList = list;
}

int setEnvIpcQRcvHdl(klpEnv* env) {
  if (!env) return KLP_RC_BAD_PARM;
  // Without a name the queue would be ".IPC", shared by every nameless server.
  const char* prefix = getEnvNamePrefix(env);
  if (!prefix) return KLP_RC_NO_SERVER;
  if (!env->rcvQueue) {
    env->rcvQueueRecovery =
        addRcvyRes(erHSVIPCQdestroy, reinterpret_cast<uint64_t>(&env->rcvQueue));
    env->rcvQueue = new (std::nothrow) HSVHIPCQueue;
    if (!env->rcvQueue) {
      endRcvyRes(env->rcvQueueRecovery);
      env->rcvQueueRecovery = nullptr;
      return KLP_RC_MSG_NO_MEMORY;
    }
  } else if (env->rcvQueue->isOpen()) {
    return KLP_OK;  // already serving: creating it again would destroy our own queue
  }

  char path[KLP_ENV_PATH_MAX + KLP_UNIQUE_NAME_SIZE + 8];
  int pathRc = ipcServerQueuePath(path, sizeof path, getEnvIPCDir(env), prefix);
  klpParmClass* parms = klpGetCurrentParms();
  if (pathRc == KLP_OK && parms && parms->getParmBool(PARM_IDX_DEBUG))
    printf("keyPath to contruct IPC = %s\n", path);

  hsvRC prc = ECF_INVALID_ARGUMENT;
  HSVResID id{};
  bool created = false;
  if (pathRc == KLP_OK) {
    prc = hsvIPCGetQueResID(path, HSV_QUEUE_RESID_OPTION, &id);
    if (prc == ECF_OK) {
      setQueueName(env, &id);
      bool usable = true;
      if (env->rcvQueue->attach(id) == ECF_OK) {
        // A previous run of this server left its queue behind; its messages
        // are stale, so it is replaced.
        logKlpMsg(592, kOriginSetQueue, KLP_DEST_LOG, queueNameOrNotSet(env), nullptr, 0);
        prc = env->rcvQueue->destroy();
        if (prc == ECF_OK) {
          logKlpMsg(595, kOriginDelQueue, KLP_DEST_LOG, queueNameOrNotSet(env), nullptr, 0);
        } else {
          env->rcvQueue->detach();
          usable = false;
        }
      }
      if (usable) {
        prc = env->rcvQueue->create(id, IPC_MAX_MSG_SIZE, HSV_CREATE_OPTION);
        created = prc == ECF_OK;
      }
    }
  }
  if (created) {
    logKlpMsg(594, kOriginSetQueue, KLP_DEST_LOG, queueNameOrNotSet(env), nullptr, 0);
    return KLP_OK;
  }

  // The queue object goes, and with it the recovery resource that would
  // otherwise act on it.
  delete env->rcvQueue;
  env->rcvQueue = nullptr;
  endRcvyRes(env->rcvQueueRecovery);
  env->rcvQueueRecovery = nullptr;
  logKlpMsg(596, kOriginSetQueue, KLP_DEST_LOG, queueNameOrNotSet(env), nullptr, 2, path,
            ecfErrorGetDescription(prc));
  logInternalError(kOriginSetQueue, static_cast<int>(prc), "HSVHIPCQueue:create");
  logKlpMsg(507, kOriginSetQueue, KLP_DEST_SEVERITY, nullptr, nullptr, 0);
  return KLP_RC_QUEUE_UNAVAILABLE;
}

void delEnvIpcQRcvHdl(klpEnv* env) {
  if (!env || !env->rcvQueue) return;
  env->rcvQueue->destroy();
  endRcvyRes(env->rcvQueueRecovery);
  env->rcvQueueRecovery = nullptr;
  delete env->rcvQueue;
  env->rcvQueue = nullptr;
  logKlpMsg(595, kOriginDelQueue, KLP_DEST_LOG, queueNameOrNotSet(env), nullptr, 0);
}

HSVHIPCQueue* getEnvIpcQRcvHdl(klpEnv* env) { return env ? env->rcvQueue : nullptr; }

const char* getEnvIpcQRcvName(klpEnv* env) {
  return env && env->rcvQueueName ? env->rcvQueueName : kNotSet;
}
