// Entry routine of klpkccmd: logger, parameter objects, command line, then
// the command is dispatched; the result becomes exit code 0 or 12.
#include "xqpub/klpkccmd.h"

#include <cctype>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "common/env/klpenv.h"
#include "common/msg/klplog.h"
#include "common/msg/msglogger.h"
#include "common/parms/klpparm.h"
#include "common/thread/klpthread.h"
#include "common/thread/recoverymgr.h"
#include "common/trace/trace_anchor.h"
#include "common/util/klprc.h"
#include "xqpub/dispatch.h"
#include "xqpub/kcapcmdparms.h"
#include "xqpub/xqpubparms.h"

namespace {

const char kProgram[] = "klpkccmd";

// Position of the first "STATUS SHOW DETAILS" (any case, three separate
// arguments), or 0 when there is none.
int findStatusShowDetails(int argc, char** argv) {
  for (int i = 1; i + 2 < argc; ++i) {
    if (!argv[i] || !argv[i + 1] || !argv[i + 2]) continue;
    if (strlen(argv[i]) != 6 || strlen(argv[i + 1]) != 4 || strlen(argv[i + 2]) != 7) continue;
    std::string joined = std::string(argv[i]) + " " + argv[i + 1] + " " + argv[i + 2];
    for (char& c : joined) c = static_cast<char>(toupper(static_cast<unsigned char>(c)));
    if (joined == "STATUS SHOW DETAILS") return i;
  }
  return 0;
}

// What must survive a jump back to the recovery point lives here, not in
// the entry routine's frame (locals changed after sigsetjmp are unreliable).
struct Run {
  msgLogger* logger = nullptr;
  kCapCmdParmClass* cmdParms = nullptr;
  xqpubParms* serverParms = nullptr;
  std::string usage;
  int rc = KLP_OK;
};
Run g_run;

// Steps 3 to 7: parameter objects, command line, name prefix, dispatch.
// A nonzero rc on entry (prologue failed, or a trap brought us back) only
// lets the objects be built and the failure be reported.
void runCommand(int argc, char** argv) {
  Run& r = g_run;
  int detailsFlag = 0;

  // 3. Both parameter objects, always constructed so that the end of the run
  //    releases them whatever happened (once, even after a trap).
  int cmdRc = KLP_OK, serverRc = KLP_OK;
  if (!r.cmdParms) {
    ParmEntry cmdTable[KCAPCMD_PARM_COUNT];
    buildKCapCmdParmTable(cmdTable);
    r.cmdParms = new kCapCmdParmClass(cmdTable, KCAPCMD_PARM_COUNT, &cmdRc);
    ParmEntry serverTable[XQPUB_PARM_COUNT];
    buildXqpubParmTable(serverTable);
    r.serverParms = new xqpubParms(serverTable, XQPUB_PARM_COUNT, &serverRc);
    r.usage = kCapCmdUsageText;
  }

  // 4. A failed prologue or a trap, then a refused table, ends the run.
  if (r.rc) {
    logInternalError(kProgram, r.rc, "threadPrologue");
    return;
  }
  if (cmdRc) {
    r.rc = cmdRc;
    logInternalError(kProgram, r.rc, "kCapCmdParmClass");
    return;
  }
  if (serverRc) {
    r.rc = serverRc;
    logInternalError(kProgram, r.rc, "xqpubParms");
    return;
  }

  // 5. Publish the command set; record the program and its level.
  klpSetCurrentParms(r.cmdParms);
  r.cmdParms->setUsageText(r.usage.c_str());
  r.cmdParms->setServerParms(r.serverParms);
  setEnvTovRIB(klpGetEnv(), "xqpubcmd", 9, 7, 8);

  // 6. STATUS SHOW DETAILS: the parser sees STATUS only.
  int at = findStatusShowDetails(argc, argv);
  if (at > 0) {
    detailsFlag = 1;
    std::vector<char*> shortened;
    for (int i = 0; i < argc; ++i)
      if (i != at + 1 && i != at + 2) shortened.push_back(argv[i]);
    shortened.push_back(nullptr);
    r.rc = r.cmdParms->processCommandLine(argc - 2, shortened.data());
  } else {
    r.rc = r.cmdParms->processCommandLine(argc, argv);
  }
  if (r.rc) {
    logInternalError(kProgram, r.rc, "processCommandLine");
    return;
  }

  // 7. Messages from here on carry the schema of the command line.
  const ParmEntry* schema = r.cmdParms->peekSlot(PARM_IDX_SCHEMA);
  if (schema && schema->strValue) r.logger->setProgramQualifier(schema->strValue);

  // The server's queue is named by the prefix; a trace may be on for it.
  // The command program writes its own trace points into the server's
  // block and leaves the block's holding and freeing to the server.
  klpEnv* env = klpGetEnv();
  int prc = setEnvNamePrefix(env, "KCAP");
  if (prc != KLP_OK) {
    logInternalError(kProgram, prc, "setEnvNamePrefix");  // the routine's own reason
    r.rc = KLP_RC_NO_SERVER;
    return;
  }
  trcAttach(getEnvIPCDir(env), getEnvNamePrefix(env), &env->appVersion, nullptr);

  // 8. Send the command, or fetch and print the detailed status.
  r.rc = klpCmdDispatch(detailsFlag);
}

}  // namespace

int klpkccmdMain(int argc, char** argv) {
  Run& r = g_run;

  // 1. The logger comes first: every later step reports through it.
  r.logger = createMsgLoggerU(MSG_APP_KLPKCCMD, 0);
  if (!r.logger) {
    printf("Program cannot run\n");
    return -1;
  }
  klpSetProcessLogger(r.logger);

  // 2. Built-in message texts.
  r.logger->loadBuiltinMsgs(builtinMsgTable);

  // Process services: the trace anchor, the main thread, its recovery point.
  trcInitAnchor();
  klpThread* mainThread = klpMainThread();
  r.rc = klpThread::prologue(mainThread);
  // A hang-up, a closed pipe or any other signal that ends the program
  // still destroys its reply queue first (at the recovery point).
  erCatchEndingSignals();
  if (r.rc) {
    logInternalError("threadPrologue", r.rc, "klpThread::prologue");
  } else if (KLP_SET_RECOVERY_POINT(mainThread->rcvyMgr) != 0) {
    // Back from a trap: the command is never sent again. A fourth return
    // ends the thread at once with 2010.
    r.rc = recoveryMgr::erRecover(&mainThread->rcvyMgr, mainThread);
    logInternalError("threadPrologue", r.rc, "setRecoveryPoint");
  }

  runCommand(argc, argv);

  // 9. Trace detach, release what the run owns, end through the main thread.
  trcDetach();
  int rc = r.rc;
  klpSetCurrentParms(nullptr);
  delete r.serverParms;
  delete r.cmdParms;
  r.serverParms = nullptr;
  r.cmdParms = nullptr;
  fflush(stdout);
  klpSetProcessLogger(nullptr);
  delete r.logger;
  r.logger = nullptr;
  threadEnd(mainThread, rc);
}
