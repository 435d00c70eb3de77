// Entry routine of klpkccmd: logger, parameter objects, command line, then
// the command is dispatched; the result becomes exit code 0 or 12.
#include "xqpub/klpkccmd.h"

#include <cctype>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "common/msg/klplog.h"
#include "common/msg/msglogger.h"
#include "common/parms/klpparm.h"
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

}  // namespace

int klpkccmdMain(int argc, char** argv) {
  int rc = KLP_OK;

  // 1. The logger comes first: every later step reports through it.
  msgLogger* logger = createMsgLoggerU(MSG_APP_KLPKCCMD, 0);
  if (!logger) {
    printf("Program cannot run\n");
    return -1;
  }
  klpSetProcessLogger(logger);

  // 2. Built-in message texts.
  logger->loadBuiltinMsgs(builtinMsgTable);

  // [process services: trace anchor, main-thread prologue and the recovery
  //  point are set up here, before the parameter objects exist]

  // 3. Both parameter objects, always constructed so that the end of the run
  //    releases them whatever happened.
  ParmEntry cmdTable[KCAPCMD_PARM_COUNT];
  buildKCapCmdParmTable(cmdTable);
  int cmdRc = KLP_OK;
  auto* cmdParms = new kCapCmdParmClass(cmdTable, KCAPCMD_PARM_COUNT, &cmdRc);

  ParmEntry serverTable[XQPUB_PARM_COUNT];
  buildXqpubParmTable(serverTable);
  int serverRc = KLP_OK;
  auto* serverParms = new xqpubParms(serverTable, XQPUB_PARM_COUNT, &serverRc);

  std::string usage = kCapCmdUsageText;  // owned for the life of the run
  int detailsFlag = 0;

  // 4. A refused table ends the run.
  // [process services: a failed prologue or a return to the recovery point
  //  is reported here, before the constructors' results]
  if (cmdRc) {
    rc = cmdRc;
    logInternalError(kProgram, rc, "kCapCmdParmClass");
  } else if (serverRc) {
    rc = serverRc;
    logInternalError(kProgram, rc, "xqpubParms");
  }

  if (rc == KLP_OK) {
    // 5. Publish the command set.
    klpSetCurrentParms(cmdParms);
    cmdParms->setUsageText(usage.c_str());
    cmdParms->setServerParms(serverParms);
    // [process services: program name and level recorded here]

    // 6. STATUS SHOW DETAILS: the parser sees STATUS only.
    int at = findStatusShowDetails(argc, argv);
    if (at > 0) {
      detailsFlag = 1;
      std::vector<char*> shortened;
      for (int i = 0; i < argc; ++i)
        if (i != at + 1 && i != at + 2) shortened.push_back(argv[i]);
      shortened.push_back(nullptr);
      rc = cmdParms->processCommandLine(argc - 2, shortened.data());
    } else {
      rc = cmdParms->processCommandLine(argc, argv);
    }
    if (rc) logInternalError(kProgram, rc, "processCommandLine");
  }

  if (rc == KLP_OK) {
    // 7. Messages from here on carry the schema of the command line.
    const ParmEntry* schema = cmdParms->peekSlot(PARM_IDX_SCHEMA);
    if (schema && schema->strValue) logger->setProgramQualifier(schema->strValue);

    // [process services: name prefix and trace attach here]
    rc = klpCmdDispatch(detailsFlag);
  }

  // 8. End of the run.
  // [process services: trace detach and the main thread's end here]
  klpSetCurrentParms(nullptr);
  delete serverParms;
  delete cmdParms;
  fflush(stdout);
  klpSetProcessLogger(nullptr);
  delete logger;
  return rc == KLP_OK ? 0 : 12;
}
