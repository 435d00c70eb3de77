// Command-line parsing of the parameter registry: the help request, the
// early schema, environment defaults, a leading server name without keyword,
// NAME=value arguments, switches and command words, and the rules every
// program applies afterwards (server name, schema, path, password file).
#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <fcntl.h>
#include <unistd.h>

#include "common/msg/klplog.h"
#include "common/msg/msglogger.h"
#include "common/parms/klpparm.h"
#include "common/parms/parmutil.h"
#include "common/util/klprc.h"

namespace {

const char kWhereParse[] = "klpParmClass::parseCmdLine";
const char kWherePre[] = "klpParmClass::preCmdLine";
const char kWherePos[] = "klpParmClass::getPositionalDBName";
const char kDefaultPwdFile[] = "klppwd.aut";
constexpr int KLP_RC_HELP = 416;
constexpr int KLP_RC_PWDFILE = 806;

// Working copies of an argument: long enough for any keyword and any value
// the parser accepts (1040) plus a little; longer arguments are cut, which
// only matters for prefix checks.
constexpr size_t kArgCopy = 1043;
constexpr size_t kWordCopy = 35;

bool startsWith(const char* s, const char* prefix) {
  return strncmp(s, prefix, strlen(prefix)) == 0;
}

const char* slotText(const ParmEntry* s) {
  return (s && s->strValue) ? s->strValue : "";
}

// Opened without blocking, so that a FIFO under the expected name cannot
// hang the program.
bool readable(const std::string& file) {
  int fd = open(file.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC);
  if (fd < 0) return false;
  close(fd);
  return true;
}

}  // namespace

void klpParmClass::replaceSlotText(int index, const char* text) {
  ParmEntry& s = slots_[index];
  char* fresh = (text && *text) ? strdup(text) : nullptr;
  if (s.strValue && s.strValue != klpEmptyText) free(s.strValue);
  s.strValue = fresh ? fresh : klpEmptyText;
}

bool klpParmClass::normaliseSchema() {
  const ParmEntry* s = peekSlot(PARM_IDX_SCHEMA);
  if (!s || s->type != PARM_STRING) return true;
  std::string v;
  if (!applySchemaRule(slotText(s), &v)) return false;
  // Rewritten rather than edited in place: upper case may need more bytes
  // than the old text had under a multibyte locale.
  if (v != slotText(s)) replaceSlotText(PARM_IDX_SCHEMA, v.c_str());
  return true;
}

int klpParmClass::processCommandLine(int argc, char** argv) {
  int n = argc > 0 ? argc - 1 : 0;
  char** args = argc > 0 ? argv + 1 : argv;
  int rc = preCmdLine(n, args);
  if (rc) {
    logInternalError("klpParmClass::processCommandLine", rc, "preCmdLine");
    return rc;
  }
  rc = parseCmdLine(n, args);
  if (rc) logInternalError("klpParmClass::processCommandLine", rc, "parseCmdLine");
  return rc;
}

int klpParmClass::preCmdLine(int argc, char** argv) {
  if (argc >= 1 && argv[0] && strcmp(argv[0], "?") == 0) {
    printf("%s", usage_);
    fflush(stdout);
    return KLP_RC_HELP;
  }

  const ParmEntry& schema = slots_[PARM_IDX_SCHEMA];
  std::string schemaPrefix = std::string(schema.name) + "=";
  char up[kArgCopy];
  for (int i = 0; i < argc; ++i) {
    if (!argv[i]) continue;
    upperCopy(argv[i], up, sizeof up);
    if (startsWith(up, schemaPrefix.c_str())) {
      // The value held so far must itself be a valid schema before the new
      // one replaces it.
      if (!normaliseSchema()) {
        logKlpMsg(500, "klpParmClass::preCmdLine", KLP_DEST_CONSOLE, slotText(&schema), nullptr,
                  1, schema.name);
        return KLP_RC_BAD_PARM;
      }
      int rc = setParm(PARM_IDX_SCHEMA, argv[i] + schemaPrefix.size(), PARM_SRC_COMMANDLINE);
      if (rc) {
        logInternalError(kWherePre, rc, "setParm");
        return rc;
      }
    } else if (startsWith(up, "KLPPLACEHOLDER")) {
      logKlpMsg(504, "klpParmClass:preCmdLine", KLP_DEST_CONSOLE, argv[i], nullptr, 0);
      return KLP_RC_BAD_PARM;
    }
  }

  if (const char* sid = getenv("ORACLE_SID")) {
    int rc = setParm(PARM_IDX_SERVER, sid, PARM_SRC_DEFAULT);
    if (rc) {
      logInternalError(kWherePre, rc, "setParm");
      return rc;
    }
  }

  char cwd[1041];
  if (!getcwd(cwd, sizeof cwd)) cwd[0] = '\0';
  int rc = setParm(PARM_IDX_PATH, cwd, PARM_SRC_DEFAULT);
  if (rc) {
    logInternalError(kWherePre, rc, "setParm");
    return rc;
  }

  msgLogger* logger = klpGetProcessLogger();
  klpParmClass* current = klpGetCurrentParms();
  if (logger && current) {
    const ParmEntry* s = current->peekSlot(PARM_IDX_SCHEMA);
    if (s && s->type == PARM_STRING) logger->setProgramQualifier(slotText(s));
  }
  return KLP_OK;
}

int klpParmClass::getPositionalDBName(int argc, char** argv, int* consumed) {
  int dummy = 0;
  if (!consumed) consumed = &dummy;
  *consumed = 0;

  const char* serverName = slots_[PARM_IDX_SERVER].name;
  bool serverByKeyword = false;
  for (int i = 0; i < argc && !serverByKeyword; ++i) {
    if (!argv[i] || !strchr(argv[i], '=')) continue;
    char kw[KLP_PARM_NAME_MAX + 1];
    size_t len = 0;
    if (upperKeyword(argv[i], kw, &len) && strcmp(kw, serverName) == 0) serverByKeyword = true;
  }

  const char* sid = getenv("ORACLE_SID");
  if (argc <= 0 || !argv[0]) return KLP_OK;

  const char* first = argv[0];
  if (!strchr(first, '=')) {
    // A word too long for any parameter name is a server name.
    char word[kWordCopy];
    size_t len = strlen(first);
    bool namesParm = false;
    if (len < sizeof word) {
      upperCopy(first, word, sizeof word);
      if (!startsWith(word, "KLPPLACEHOLDER")) {
        int s = findSlot(word, len, true);
        namesParm = s >= 0 && slots_[s].index != -1;
      }
    }
    if (!namesParm) {
      int rc = setParm(PARM_IDX_SERVER, first, PARM_SRC_COMMANDLINE);
      if (rc) {
        logInternalError(kWherePos, rc, "setParm 1");
        return rc;
      }
      *consumed = 1;
      return KLP_OK;
    }
    if (serverByKeyword) return KLP_OK;
    if (!sid) {
      int rc = setParm(PARM_IDX_SERVER, first, PARM_SRC_COMMANDLINE);
      if (rc) {
        logInternalError(kWherePos, rc, "setParm 2");
        return rc;
      }
      *consumed = 1;
      return KLP_OK;
    }
    int rc = setParm(PARM_IDX_SERVER, sid, PARM_SRC_DEFAULT);
    if (rc) {
      logInternalError(kWherePos, rc, "setParm 3");
      return rc;
    }
    return KLP_OK;
  }

  if (serverByKeyword || sid) return KLP_OK;
  logKlpMsg(524, kWherePos, KLP_DEST_SEVERITY, serverName, nullptr, 0);
  return KLP_RC_NO_SERVER;
}

int klpParmClass::parseCmdLine(int argc, char** argv) {
  bool commandGiven = false;
  for (int i = 0; i < argc; ++i) {
    const char* arg = argv[i] ? argv[i] : "";
    const char* eq = strchr(arg, '=');

    char kw[KLP_PARM_NAME_MAX + 1];
    size_t kwLen = 0;
    if (!upperKeyword(arg, kw, &kwLen) || startsWith(kw, "KLPPLACEHOLDER")) {
      logKlpMsg(504, kWhereParse, KLP_DEST_SEVERITY, arg, nullptr, 0);
      return KLP_RC_BAD_PARM;
    }
    // A bare word can only be a switch or a command.
    int pos = findSlot(kw, kwLen, eq != nullptr);
    if (pos < 0 || slots_[pos].index == -1) {
      logKlpMsg(504, kWhereParse, KLP_DEST_SEVERITY, arg, nullptr, 0);
      return KLP_RC_BAD_PARM;
    }
    ParmEntry& s = slots_[pos];
    const int index = s.index;

    size_t restLen = eq ? strlen(eq) : 0;  // the "=" counts
    const char* value = eq ? eq + 1 : "";
    if (restLen > KLP_PARM_VALUE_MAX) {
      char lenText[24];
      snprintf(lenText, sizeof lenText, "%zu", restLen);
      logKlpMsg(502, kWhereParse, KLP_DEST_SEVERITY, value, nullptr, 3, lenText, s.name, "1040");
      return KLP_RC_BAD_PARM;
    }

    int rc = KLP_OK;
    switch (s.type) {
      case PARM_BOOLEAN: {
        int32_t on = 1;
        if (eq) {
          char up[5];
          upperCopy(value, up, sizeof up);
          if (strlen(value) <= 3 && (!strcmp(up, "Y") || !strcmp(up, "YES"))) {
            on = 1;
          } else if (strlen(value) <= 2 && (!strcmp(up, "N") || !strcmp(up, "NO"))) {
            on = 0;
          } else {
            logKlpMsg(501, kWhereParse, KLP_DEST_SEVERITY, value, nullptr, 1, s.name);
            return KLP_RC_BAD_PARM;
          }
        }
        rc = setParmBool(index, on, PARM_SRC_COMMANDLINE);
        break;
      }
      case PARM_COMMAND:
        if (commandGiven) {
          logKlpMsg(518, kWhereParse, KLP_DEST_SEVERITY, nullptr, nullptr, 0);
          return KLP_RC_BAD_PARM;
        }
        rc = setCommand(index, 1, value, PARM_SRC_COMMANDLINE);
        commandGiven = true;
        break;
      case PARM_INTEGER:
      case PARM_STRING:
        if (!eq) {
          logKlpMsg(504, kWhereParse, KLP_DEST_SEVERITY, arg, nullptr, 0);
          return KLP_RC_BAD_PARM;
        }
        if (*value == '\0') {
          logKlpMsg(500, kWhereParse, KLP_DEST_SEVERITY, "", nullptr, 1, s.name);
          return KLP_RC_BAD_PARM;
        }
        if (s.type == PARM_STRING) {
          rc = setParm(index, value, PARM_SRC_COMMANDLINE);
          break;
        }
        {
          errno = 0;
          char* end = nullptr;
          long long v = strtoll(value, &end, 10);
          bool overflow = errno == ERANGE;
          if (*end != '\0') {
            logKlpMsg(overflow ? 503 : 500, kWhereParse, KLP_DEST_SEVERITY, value, nullptr, 1,
                      s.name);
            return KLP_RC_BAD_PARM;
          }
          if (overflow || v >= INT32_MAX || v < -INT32_MAX) {
            logKlpMsg(503, kWhereParse, KLP_DEST_SEVERITY, value, nullptr, 1, s.name);
            return KLP_RC_BAD_PARM;
          }
          if (v < s.minimum || v > s.maximum) {
            char num[16];
            snprintf(num, sizeof num, "%d", static_cast<int>(v));
            logKlpMsg(503, "klpParmClass:setParm", KLP_DEST_CONSOLE, num, nullptr, 1, s.name);
            return KLP_RC_BAD_PARM;
          }
          if (s.source < PARM_SRC_CHGPARMS) {
            s.intValue = static_cast<int32_t>(v);
            s.source = PARM_SRC_COMMANDLINE;
          }
        }
        break;
      default:
        logKlpMsg(504, kWhereParse, KLP_DEST_SEVERITY, arg, nullptr, 0);
        return KLP_RC_BAD_PARM;
    }
    if (rc) {
      logInternalError(kWhereParse, rc, "klpParmClass::setParm");
      return rc;
    }
  }

  // Rules every program applies once its arguments are in.
  if (*slotText(&slots_[PARM_IDX_SERVER]) == '\0') {
    logKlpMsg(524, kWhereParse, KLP_DEST_SEVERITY, slots_[PARM_IDX_SERVER].name, nullptr, 0);
    return KLP_RC_BAD_PARM;
  }
  if (*slotText(&slots_[PARM_IDX_SCHEMA]) == '\0') {
    logKlpMsg(524, kWhereParse, KLP_DEST_SEVERITY, slots_[PARM_IDX_SCHEMA].name, nullptr, 0);
    return KLP_RC_BAD_PARM;
  }
  if (!normaliseSchema()) {
    logKlpMsg(500, kWhereParse, KLP_DEST_SEVERITY, slotText(&slots_[PARM_IDX_SCHEMA]), nullptr,
              1, slots_[PARM_IDX_SCHEMA].name);
    return KLP_RC_BAD_PARM;
  }

  // The path always ends with a directory separator. The separator is
  // stored back as it is: a directory the user may give (or be in) at the
  // value's longest must not become too long by it.
  std::string path = slotText(&slots_[PARM_IDX_PATH]);
  if (path.empty() || path.back() != '/') {
    path += '/';
    if (slots_[PARM_IDX_PATH].type == PARM_STRING) replaceSlotText(PARM_IDX_PATH, path.c_str());
  }

  ParmEntry& pwd = slots_[PARM_IDX_PWDFILE];
  if (pwd.type == PARM_STRING) {
    if (pwd.source != PARM_SRC_DEFAULT) {
      std::string file = path + slotText(&pwd);
      if (!readable(file)) {
        logKlpMsg(545, kWhereParse, KLP_DEST_SEVERITY, file.c_str(), nullptr, 0);
        return KLP_RC_PWDFILE;
      }
    } else {
      if (*slotText(&pwd) == '\0') replaceSlotText(PARM_IDX_PWDFILE, kDefaultPwdFile);
      if (!readable(path + slotText(&pwd))) replaceSlotText(PARM_IDX_PWDFILE, "");
    }
  }

  // Server names are upper case whatever the user typed.
  ParmEntry& server = slots_[PARM_IDX_SERVER];
  if (server.strValue && server.strValue != klpEmptyText)
    for (char* p = server.strValue; *p; ++p) *p = parmUpper(*p);
  return KLP_OK;
}
