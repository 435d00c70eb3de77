// The K Capture server's parameter set and its command-line rule.
#include "xqpub/xqpubparms.h"

#include <cstring>

#include "common/msg/klplog.h"
#include "common/parms/parmutil.h"
#include "common/util/klprc.h"

namespace {

const char kWhere[] = "xqpubParms::processCommandLine";
constexpr int32_t kBig = 2000000000;

ParmEntry str(int index, const char* name, int limit, const char* def, int display) {
  return makeParmEntry(index, name, 0, PARM_STRING, -1, limit, -1, def, 0, display, 0);
}
ParmEntry boolean(int index, const char* name, int def, int display, int changeable) {
  return makeParmEntry(index, name, 0, PARM_BOOLEAN, -1, -1, -1, nullptr, def, display,
                       changeable);
}
ParmEntry integer(int index, const char* name, int32_t lo, int32_t hi, int32_t def, int display,
                  int changeable, int matchLength = 0) {
  return makeParmEntry(index, name, matchLength, PARM_INTEGER, lo, hi, def, nullptr, 0, display,
                       changeable);
}

}  // namespace

void buildXqpubParmTable(ParmEntry* t) {
  int i = 0;
  t[i++] = str(0, "CAPTURE_SERVER", 1040, "", 1);
  t[i++] = str(2, "CAPTURE_SCHEMA", 1040, "KLP", 1);
  t[i++] = boolean(1, "DEBUG", 0, 1, 0);
  t[i++] = boolean(XQPUB_LOGREUSE, "LOGREUSE", 0, 1, 1);
  t[i++] = boolean(4, "LOGSTDOUT", 0, 1, 1);
  t[i++] = boolean(XQPUB_TERM, "TERM", 0, 1, 1);
  t[i++] = str(6, "PWDFILE", 1040, "", 1);
  t[i++] = integer(XQPUB_DBRANGE, "DBRANGE", 0, 99, 2, 0, 0);
  t[i++] = str(XQPUB_QMGR, "QMGR", 1040, "", 1);
  t[i++] = str(7, "CAPTURE_PATH", 1040, "", 1);
  t[i++] = boolean(47, "AUTOSTOP", 0, 1, 1);
  t[i++] = integer(XQPUB_COMMIT_INTERVAL, "COMMIT_INTERVAL", 100, 600000, 500, 1, 1);
  t[i++] = integer(XQPUB_SLEEP_INTERVAL, "SLEEP_INTERVAL", 1, kBig, 5000, 1, 1);
  t[i++] = integer(34, "MEMORY_LIMIT", 1, 100000, 32, 1, 1);
  t[i++] = integer(35, "MONITOR_INTERVAL", 1, kBig, 300000, 1, 1);
  t[i++] = integer(36, "MONITOR_LIMIT", 1, kBig, 10080, 1, 1);
  t[i++] = integer(41, "TRACE_LIMIT", 1, kBig, 10080, 1, 1);
  t[i++] = str(XQPUB_STARTMODE, "STARTMODE", 1040, "WARMSI", 1);
  t[i++] = str(XQPUB_ADMINQ, "ADMINQ", 1040, "", 1);
  t[i++] = str(XQPUB_RESTARTQ, "RESTARTQ", 1040, "", 1);
  t[i++] = integer(51, "SIGNAL_LIMIT", 1, kBig, 10080, 1, 1);
  t[i++] = integer(53, "PRUNE_INTERVAL", 1, kBig, 300, 1, 1);
  t[i++] = integer(28, "TEST_HOOK", 0, 99, 0, 1, 1);
  t[i++] = str(55, "CAP_DBNAME", 1040, "", 1);
  t[i++] = integer(14, "LOGBUF", 0, kBig, 0, 0, 0);
  t[i++] = boolean(15, "ADD_PARTITION", 0, 1, 0);
  t[i++] = str(31, "LSN", 24, "", 1);
  t[i++] = str(32, "MAXCMTSEQ", 24, "", 1);
  t[i++] = boolean(XQPUB_KLPTRC, "KLPTRC", 0, 0, 0);
  t[i++] = boolean(XQPUB_TRCSTART, "TRCSTART", 0, 0, 0);
  t[i++] = boolean(11, "CAF", 0, 0, 0);
  t[i++] = boolean(12, "DIAGLOG", 1, 1, 0);
  t[i++] = str(33, "COMPATIBILITY", 1040, "0802", 1);
  t[i++] = boolean(17, "MIGRATE", 0, 0, 0);
  t[i++] = integer(18, "WARNIFI", 0, kBig, 0, 1, 1);
  t[i++] = str(XQPUB_IGNORE_TRANSID, "IGNORE_TRANSID", 24, "", 1);
  // Any keyword of 7 or more characters beginning "QFULL_N" / "QFULL_R".
  t[i++] = integer(XQPUB_QFULL_NUM_RETRIES, "QFULL_NUM_RETRIES", 0, 1000, 30, 1, 1, 7);
  t[i++] = integer(XQPUB_QFULL_RETRY_DELAY, "QFULL_RETRY_DELAY", 10, 3600000, 250, 1, 1, 7);
  t[i++] = integer(XQPUB_RN, "RN", 0, 1000, 30, 0, 0);
  t[i++] = integer(XQPUB_RD, "RD", 10, 3600000, 250, 0, 0);
  t[i++] = str(XQPUB_TRANSID, "TRANSID", 24, "", 0);
  t[i++] = str(13, "ARM", 16, "", 0);
  t[i++] = str(42, "LOB_SEND_OPTION", 1, "I", 1);
  t[i++] = integer(21, "STALE", 1, kBig, 3600, 1, 1);
  t[i++] = boolean(44, "IGNTRIG", 0, 1, 0);
  t[i++] = boolean(45, "MSG_PERSISTENCE", 1, 1, 0);
  t[i++] = boolean(46, "STARTALLQ", 1, 1, 0);
  t[i++] = integer(22, "LOGRDBUFSZ", 10, 5000, 256, 1, 0);
  t[i++] = boolean(23, "HS", 0, 1, 0);
  t[i++] = boolean(24, "IGNCASDEL", 0, 1, 0);
  t[i++] = integer(50, "TRANS_BATCH_SZ", 1, 128, 1, 1, 0);
  t[i++] = integer(25, "PART_HIST_LIMIT", 1, kBig, 10080, 1, 1);
  t[i++] = boolean(52, "BIDI_BEFORE_VALUES", 0, 1, 0);
  t[i++] = boolean(27, "LOGREAD_PREFETCH", 0, 1, 0);
  t[i++] = integer(26, "WARNTXSZ", 0, kBig, 0, 1, 1);
  t[i++] = str(54, "LOGRD_ERROR_ACTION", 1, "D", 1);
}

int xqpubParms::processCommandLine(int argc, char** argv) {
  int n = argc > 0 ? argc - 1 : 0;
  char** args = argc > 0 ? argv + 1 : argv;

  int rc = preCmdLine(n, args);
  if (rc) {
    logInternalError(kWhere, rc, "preCmdLine");
    return rc;
  }

  // Queue names come from the server's control table only.
  for (int i = 0; i < argc; ++i) {
    if (!argv[i]) continue;
    char up[34];
    upperCopy(argv[i], up, sizeof up);
    if (!strncmp(up, "QMGR=", 5) || !strncmp(up, "ADMINQ=", 7) || !strncmp(up, "RESTARTQ=", 9)) {
      logKlpMsg(504, kWhere, KLP_DEST_SEVERITY, argv[i], nullptr, 0);
      return KLP_RC_BAD_PARM;
    }
  }

  int consumed = 0;
  rc = getPositionalDBName(n, args, &consumed);
  if (rc) {
    logInternalError(kWhere, rc, "getPositionalDBName");
    return rc;
  }
  rc = parseCmdLine(n - consumed, args + consumed);
  if (rc) {
    logInternalError(kWhere, rc, "parseCmdLine");
    return rc;
  }

  ParmEntry& mode = slot(XQPUB_STARTMODE);
  if (mode.strValue && mode.strValue != klpEmptyText)
    for (char* p = mode.strValue; *p; ++p) *p = parmUpper(*p);
  const char* m = mode.strValue ? mode.strValue : "";
  if (strcmp(m, "WARMSI") && strcmp(m, "WARMNS") && strcmp(m, "COLD")) {
    logKlpMsg(500, kWhere, KLP_DEST_SEVERITY, m, nullptr, 1, "STARTMODE");
    rc = KLP_RC_BAD_PARM;
  }

  // Short forms given on the command line stand for their long forms.
  const int intPairs[2][2] = {{XQPUB_QFULL_NUM_RETRIES, XQPUB_RN},
                              {XQPUB_QFULL_RETRY_DELAY, XQPUB_RD}};
  for (const auto& p : intPairs) {
    if (slot(p[0]).source != PARM_SRC_COMMANDLINE && slot(p[1]).source == PARM_SRC_COMMANDLINE) {
      int r = setParm(p[0], slot(p[1]).intValue, PARM_SRC_COMMANDLINE);
      if (r && !rc) rc = r;
    }
  }
  if (slot(XQPUB_IGNORE_TRANSID).source != PARM_SRC_COMMANDLINE &&
      slot(XQPUB_TRANSID).source == PARM_SRC_COMMANDLINE) {
    int r = setParm(XQPUB_IGNORE_TRANSID, slot(XQPUB_TRANSID).strValue, PARM_SRC_COMMANDLINE);
    if (r && !rc) rc = r;
  }
  return rc;
}
