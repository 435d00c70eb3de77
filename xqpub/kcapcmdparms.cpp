// The command program's parameter set and its command-line rule.
#include "xqpub/kcapcmdparms.h"

#include <cstdio>
#include <cstring>
#include <vector>

#include "common/msg/klplog.h"
#include "common/parms/parmutil.h"
#include "common/util/klprc.h"

const char kCapCmdUsageText[] =
    "klpkccmd [<parameter>=<value> ...] [command]\n"
    "parameter:\n"
    "  CAPTURE_SCHEMA= : Name of schema used to identify a K Capture program.\n"
    "  CAPTURE_SERVER= : Name of the K Capture control server.\n"
    "  LOGSTDOUT=Y|N   : Send messages to standard output.\n"
    "\n"
    "command:\n"
    "  CHGPARMS        : Change K Capture's operational parameters.\n"
    "  PRUNE           : Prune K Capture's control tables.\n"
    "  QRYPARMS        : Query K Captures's operational parameters.\n"
    "  REINIT          : Reinitialize all of K Capture's subscriptions.\n"
    "  REINITQ=        : Reinitialize one of K Capture's send queues.\n"
    "  STARTQ=         : Start one or all of K Capture's send queues.\n"
    "  STATUS          : Query the status of K Capture's threads.\n"
    "  STOP            : Stop the K Capture program.\n"
    "  STOPQ=          : Stop one or all of K Capture's send queues.\n"
    "  TRCSTART        : Start writing program flow information to the K Capture trace buffer.\n"
    "\n";

namespace {

const char kWhere[] = "kCapCmdParmClass::processCommandLine";
const char kHolder[] = "KLPPLACEHOLDER";

ParmEntry str(int index, const char* name, int limit, const char* def) {
  return makeParmEntry(index, name, 0, PARM_STRING, -1, limit, -1, def, 0, 0, 0);
}
ParmEntry boolean(int index, const char* name) {
  return makeParmEntry(index, name, 0, PARM_BOOLEAN, -1, -1, -1, nullptr, 0, 0, 0);
}
ParmEntry command(int index, const char* name) {
  return makeParmEntry(index, name, 0, PARM_COMMAND, -1, -1, -1, nullptr, 0, 0, 0);
}

}  // namespace

void buildKCapCmdParmTable(ParmEntry* t) {
  int i = 0;
  t[i++] = str(0, "CAPTURE_SERVER", 1040, "");
  t[i++] = str(2, "CAPTURE_SCHEMA", 128, "KLP");
  t[i++] = boolean(1, "DEBUG");
  t[i++] = boolean(3, kHolder);
  t[i++] = boolean(4, "LOGSTDOUT");
  t[i++] = boolean(5, kHolder);
  t[i++] = str(6, kHolder, 1040, "");  // the server's PWDFILE slot
  t[i++] = str(7, kHolder, 1040, "");  // the server's CAPTURE_PATH slot
  t[i++] = makeParmEntry(8, kHolder, 0, PARM_INTEGER, 0, 0, 0, nullptr, 0, 0, 0);
  t[i++] = command(KCAPCMD_RESERVED, kHolder);
  t[i++] = command(KCAPCMD_STOP, "STOP");
  t[i++] = command(KCAPCMD_REINIT, "REINIT");
  t[i++] = command(KCAPCMD_RESUME, "RESUME");
  t[i++] = command(KCAPCMD_PRUNE, "PRUNE");
  t[i++] = command(KCAPCMD_SUSPEND, "SUSPEND");
  t[i++] = command(KCAPCMD_STATUS, "STATUS");
  t[i++] = command(KCAPCMD_CHGPARMS, "CHGPARMS");
  t[i++] = command(KCAPCMD_QRYPARMS, "QRYPARMS");
  t[i++] = command(KCAPCMD_TRCSTART, "TRCSTART");
  t[i++] = boolean(9, "KLPTRC");
  t[i++] = command(KCAPCMD_REINITQ, "REINITQ");
  t[i++] = command(KCAPCMD_STARTQ, "STARTQ");
  t[i++] = command(KCAPCMD_STOPQ, "STOPQ");
  t[i++] = boolean(11, kHolder);
  t[i++] = boolean(12, kHolder);
  t[i++] = str(13, kHolder, 1040, "");
}

int kCapCmdParmClass::processCommandLine(int argc, char** argv) {
  int n = argc > 0 ? argc - 1 : 0;
  char** args = argc > 0 ? argv + 1 : argv;

  int rc = preCmdLine(n, args);
  if (rc) {
    logInternalError(kWhere, rc, "preCmdLine");
    return rc;
  }
  int consumed = 0;
  rc = getPositionalDBName(n, args, &consumed);
  if (rc) {
    logInternalError(kWhere, rc, "getPositionalDBName");
    return rc;
  }

  // The parser sees everything but the leading server name and the pairs
  // that follow CHGPARMS, which are checked against the server's set.
  std::vector<char*> filtered;
  klpParmClass* server = getServerParms();
  for (int i = consumed; i < n; ++i) {
    char* arg = args[i] ? args[i] : klpEmptyText;
    char kw[KLP_PARM_NAME_MAX + 1];
    size_t kwLen = 0;
    if (!upperKeyword(arg, kw, &kwLen)) {
      logKlpMsg(504, kWhere, KLP_DEST_SEVERITY, arg, nullptr, 0);
      return KLP_RC_BAD_PARM;
    }
    int pos = strncmp(kw, "KLPPLACEHOLDER", 14) ? findSlot(kw, kwLen, true) : -1;
    if (pos < 0 || slot(pos).index == -1) {
      logKlpMsg(504, kWhere, KLP_DEST_SEVERITY, arg, nullptr, 0);
      return KLP_RC_BAD_PARM;
    }
    filtered.push_back(arg);
    if (slot(pos).index != KCAPCMD_CHGPARMS) continue;

    while (server && i + 1 < n) {
      const char* pair = args[i + 1] ? args[i + 1] : "";
      char pkw[KLP_PARM_NAME_MAX + 1];
      size_t pkwLen = 0;
      if (!upperKeyword(pair, pkw, &pkwLen)) break;
      if (strlen(pair) - pkwLen > KLP_PARM_VALUE_MAX) break;
      int index = server->findChangeableParm(pkw);
      if (index < 0) break;
      const char* eq = strchr(pair, '=');
      const char* value = eq ? eq + 1 : "";
      if (!server->isValidValue(index, value)) {
        logKlpMsg(519, kWhere, KLP_DEST_CONSOLE, value, nullptr, 1, pkw);
        return KLP_RC_BAD_PARM;
      }
      rc = addChgParm(index, value);
      if (rc) return rc;
      ++i;
    }
  }

  rc = parseCmdLine(static_cast<int>(filtered.size()), filtered.data());
  if (rc) {
    logInternalError(kWhere, rc, "parseCmdLine");
    return rc;
  }

  int cmd = getNamedCommand();
  if (cmd < 0) {
    logKlpMsg(526, kWhere, KLP_DEST_CONSOLE, nullptr, nullptr, 0);
    return KLP_RC_BAD_PARM;
  }
  if (cmd == KCAPCMD_CHGPARMS && getChgParmsCount() == 0) {
    logKlpMsg(527, kWhere, KLP_DEST_CONSOLE, nullptr, nullptr, 0);
    return KLP_RC_BAD_PARM;
  }
  return KLP_OK;
}
