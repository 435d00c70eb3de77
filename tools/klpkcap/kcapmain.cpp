// klpkcap: a sample K Capture server. It takes the server's parameters, logs
// to "<server>.<schema>.KCAP.log" in CAPTURE_PATH, creates its receiving
// queue and runs the command engine on its main thread while a few named
// worker threads rest and carry out the commands they declared interest in.
// It has no database: its database status check always answers available.
//
//   klpkcap CAPTURE_SERVER=DEMO [CAPTURE_SCHEMA=KLP] [CAPTURE_PATH=dir] [LOGSTDOUT]
//
// Ends with exit code 0 after a clean STOP (or SIGINT / SIGTERM), 12 after a
// failure; its receiving queue is destroyed on every end it can see.
#include <signal.h>

#include <cstdio>
#include <cstring>

#include "common/env/klpenv.h"
#include "common/ipc/cmdsengine.h"
#include "common/msg/klplog.h"
#include "common/msg/msglogger.h"
#include "common/parms/klpparm.h"
#include "common/thread/klpthread.h"
#include "common/thread/ordlist.h"
#include "common/thread/recoverymgr.h"
#include "common/trace/trace_anchor.h"
#include "common/util/klprc.h"
#include "tools/klpkcap/kcapworkers.h"
#include "xqpub/xqpubparms.h"

namespace {

constexpr int kAppKCapture = 5;
constexpr const char* kProgram = "klpkcap";
constexpr const char* kComponent = "KCAP";

// SIGINT and SIGTERM ask for the orderly stop: the engine sees the record on
// its next pass, stops the threads and destroys the receiving queue.
void onStopSignal(int sig) { erSetGlobalSignal(sig); }

void installStopSignals() {
  struct sigaction sa;
  memset(&sa, 0, sizeof sa);
  sa.sa_handler = onStopSignal;
  sigemptyset(&sa.sa_mask);
  sa.sa_flags = SA_RESTART;
  sigaction(SIGINT, &sa, nullptr);
  sigaction(SIGTERM, &sa, nullptr);
}

[[noreturn]] void finish(int rc) {
  delEnvIpcQRcvHdl(klpGetEnv());
  trcDetach();
  threadEnd(klpMainThread(), rc);
}

void setUpLogFile(msgLogger* logger, klpParmClass* parms, const char* prefix) {
  const char* path = parms->getParmString(PARM_IDX_PATH);
  char base[1100];
  if (!msgLogBaseName(path != nullptr ? path : "", prefix, base, sizeof base)) return;
  logger->setLogFileName(path, base);
  if (parms->getParmBool(XQPUB_LOGREUSE)) logger->clearLog();
}

}  // namespace

int main(int argc, char** argv) {
  trcInitAnchor();
  trcDeclareApplication();  // the traced server: it holds a trace block while attached
  msgLogger* logger = createMsgLoggerU(kAppKCapture, 0);
  if (logger == nullptr) return 12;
  klpSetProcessLogger(logger);
  logger->loadBuiltinMsgs(builtinMsgTable);

  klpThread* mainThread = klpMainThread();
  int rc = klpThread::prologue(mainThread);
  if (rc != 0) {
    logInternalError(kProgram, rc, "klpThread::prologue");
    finish(rc);
  }
  installStopSignals();
  if (KLP_SET_RECOVERY_POINT(mainThread->rcvyMgr) != 0) {
    // A trap on the main thread: the recovery resources (the receiving queue
    // among them) ran; report and end.
    rc = recoveryMgr::erRecover(&mainThread->rcvyMgr, mainThread);
    logInternalError(kProgram, rc, "setRecoveryPoint");
    finish(rc);
  }

  ParmEntry table[XQPUB_PARM_COUNT];
  buildXqpubParmTable(table);
  int prc = 0;
  xqpubParms* parms = new xqpubParms(table, XQPUB_PARM_COUNT, &prc);
  klpSetCurrentParms(parms);
  if (prc != 0) finish(prc);
  rc = parms->processCommandLine(argc, argv);
  if (rc == 416) finish(0);  // usage printed
  if (rc != 0) finish(rc);

  klpEnv* env = klpGetEnv();
  rc = setEnvNamePrefix(env, kComponent);
  if (rc != 0) {
    logInternalError(kProgram, rc, "setEnvNamePrefix");
    finish(KLP_RC_NO_SERVER);
  }
  setUpLogFile(logger, parms, getEnvNamePrefix(env));
  setEnvTovRIB(env, kProgram, 9, 7, 8);
  setEnvModServ(env, nullptr, 0);
  trcAttach(getEnvIPCDir(env), getEnvNamePrefix(env), &env->appVersion, env->moduleList);
  cmdsSetDbStatusCheck(kcapDbStatus);

  rc = setEnvIpcQRcvHdl(env);
  if (rc != 0) {
    logInternalError(kProgram, rc, "setEnvIpcQRcvHdl");
    finish(rc);
  }

  OrdList threads;
  threads.makeShared("KCAPThreads", 1);
  // Workers block SIGINT and SIGTERM (every created thread does): these
  // reach the main thread's handler only.
  rc = kcapStartWorkers(&threads);
  if (rc != 0) {
    logInternalError(kProgram, rc, "createThread");
    stopAll(&threads);
    finish(rc);
  }

  int32_t stopRequested = 0;
  rc = cmdsEngine(&threads, CMDS_MODE_NORMAL, &stopRequested);
  // Threads the grace period did not see end are taken down now.
  if (threads.count > 0) stopAll(&threads);
  finish(rc);
}
