// Process-wide issuing functions over the process logger.
#include "common/msg/klplog.h"

#include <atomic>
#include <cstdarg>
#include <cstdio>
#include <cstring>
#include <new>

#include "common/msg/msglogger.h"
#include "common/util/klprc.h"

namespace {

std::atomic<msgLogger*> processLogger{nullptr};

uint16_t routingOfKind(int destKind) {
  if (destKind == KLP_DEST_LOG) return MSG_DEST_STDOUT_IF | MSG_DEST_LOGFILE;  // 12
  if (destKind == KLP_DEST_CONSOLE)
    return MSG_ROUTE_BY_SEVERITY | MSG_DEST_STDOUT | MSG_DEST_EXTRA;  // 35
  return MSG_ROUTE_BY_SEVERITY;
}

// Writes text into a capture buffer: a 16-bit length, then at most
// bufferChars - 1 characters and a NUL.
void capture(char* buffer, uint16_t bufferChars, const char* text) {
  if (buffer == nullptr) return;
  size_t n = text != nullptr ? strlen(text) : 0;
  if (bufferChars == 0)
    n = 0;
  else if (n > static_cast<size_t>(bufferChars - 1))
    n = bufferChars - 1;
  uint16_t len = static_cast<uint16_t>(n);
  memcpy(buffer, &len, sizeof len);
  if (bufferChars == 0) return;
  memcpy(buffer + sizeof len, text, n);
  buffer[sizeof len + n] = '\0';
}

// Collects firstValue and the further arguments into values[9], padding
// absent ones with " ". Answers the value count to pass on.
int collect(int number, const char* firstValue, int count, va_list ap, const char** values) {
  values[0] = firstValue;
  if (number == -1) return 1;
  int taken = 1;
  for (int i = 0; i < count && taken < MSG_MAX_VALUES; ++i)
    values[taken++] = va_arg(ap, const char*);
  while (taken < MSG_MAX_VALUES) values[taken++] = " ";
  return MSG_MAX_VALUES;
}

// Composes texts for a caller that asks for one but made no process logger
// (a C program using the control interface): the library's own, never
// published, which writes nowhere, not even the report of a missing
// catalogue.
class textOnlyLogger : public msgLoggerU {
 public:
  textOnlyLogger() : msgLoggerU(MSG_APP_KLPKCCMD, 0) { loadBuiltinMsgs(builtinMsgTable); }
  void writeStderr(logMsg*) override {}
};

msgLogger* textLogger() {
  if (msgLogger* logger = processLogger.load()) return logger;
  static msgLogger* own = new (std::nothrow) textOnlyLogger;
  return own;
}

int issueV(int number, const char* origin, int destKind, const char* firstValue,
           klpMsgCtx* context, char* alsoText, uint16_t alsoChars, int count, va_list ap) {
  bool textOnly = context != nullptr && context->wantText;
  msgLogger* logger = textOnly ? textLogger() : processLogger.load();
  if (logger == nullptr) return KLP_RC_BAD_PARM;
  const char* values[MSG_MAX_VALUES];
  int n = collect(number, firstValue, count, ap, values);
  if (number == -1) number = 8999;
  if (textOnly) {
    char text[MSG_DEFAULT_TEXT_SIZE + 1];
    int got = logger->getKlpMsgTextV(number, origin, " ", text, sizeof text, n, values);
    capture(context->buffer, context->bufferChars, got < 0 ? "" : text);
    return got < 0 ? KLP_RC_NO_MEMORY : KLP_OK;
  }
  int32_t e1 = -1, e2 = -1;
  if (context != nullptr) {
    e1 = context->extra1;
    e2 = context->extra2;
  }
  int rc = logger->putKlpMsgV(number, routingOfKind(destKind), origin, " ", n, values, nullptr,
                              e1, e2);
  if (alsoText != nullptr) {
    char text[MSG_DEFAULT_TEXT_SIZE + 1];
    int got = logger->getKlpMsgTextV(number, origin, " ", text, sizeof text, n, values);
    capture(alsoText, alsoChars, got < 0 ? "" : text);
    if (got < 0 && rc == 0) rc = KLP_RC_NO_MEMORY;
  }
  return rc;
}

}  // namespace

msgLogger* klpGetProcessLogger() { return processLogger.load(); }
void klpSetProcessLogger(msgLogger* logger) { processLogger.store(logger); }

int logKlpMsg(int number, const char* origin, int destKind, const char* firstValue,
              klpMsgCtx* context, int count, ...) {
  va_list ap;
  va_start(ap, count);
  int rc = issueV(number, origin, destKind, firstValue, context, nullptr, 0, count, ap);
  va_end(ap);
  return rc;
}

int logKlpMsgAndText(int number, const char* origin, int destKind, char* buffer,
                     uint16_t bufferChars, const char* firstValue, int count, ...) {
  va_list ap;
  va_start(ap, count);
  int rc = issueV(number, origin, destKind, firstValue, nullptr, buffer, bufferChars, count, ap);
  va_end(ap);
  return rc;
}

void logInternalError(const char* origin, int rc, const char* operation, const char* detail) {
  char code[16];
  snprintf(code, sizeof code, "%d", rc);
  logKlpMsg(589, origin, KLP_DEST_SEVERITY, origin, nullptr, 2, code, operation);
  msgLogger* logger = processLogger.load();
  if (logger != nullptr && detail != nullptr && detail[0] != '\0')
    logger->putKlpMsg(8999, MSG_DEST_LOGFILE, origin, " ", detail);
}

int logSqlError(const msgSqlca* sqlca, const char* origin, int destKind, const char* text1,
                const char* text2, const char* text3) {
  msgLogger* logger = processLogger.load();
  if (logger == nullptr || sqlca == nullptr) return KLP_RC_BAD_PARM;
  if (sqlca->sqlcode == -952) return KLP_OK;
  uint16_t routing = destKind == KLP_DEST_LOG ? 12 : destKind == KLP_DEST_CONSOLE ? 3 : 1;
  char code[16], state[6], tokens[71], where[9];
  snprintf(code, sizeof code, "%d", sqlca->sqlcode);
  snprintf(state, sizeof state, "%.5s", sqlca->sqlstate);
  // The token length comes from the database: never read past the field.
  int tl = sqlca->sqlerrml;
  if (tl < 0) tl = 0;
  if (tl > 70) tl = 70;
  snprintf(tokens, sizeof tokens, "%.*s", tl, sqlca->sqlerrmc);
  snprintf(where, sizeof where, "%.8s", sqlca->sqlerrp);
  const char* first = text1 != nullptr ? text1 : "";
  int rc = logger->putKlpMsg(552, routing, origin, " ", first, text2, text3, code, state, tokens,
                             where);
  if (sqlca->sqlcode == -964) {
    int rc2 = logger->putKlpMsg(554, routing, origin, " ", first);
    if (rc == 0) rc = rc2;
  }
  return rc;
}

int logXqError(int reason, const char* origin, int destKind, int use574, const char* text1,
               const char* text2) {
  msgLogger* logger = processLogger.load();
  if (logger == nullptr) return KLP_RC_BAD_PARM;
  uint16_t routing = routingOfKind(destKind);
  if (use574 && (reason == 2162 || reason == 2161 || reason == 2059))
    return logger->putKlpMsg(574, routing, origin, " ", logger->getSqlMsgText());
  char code[16];
  snprintf(code, sizeof code, "%d", reason);
  return logger->putKlpMsg(575, routing, origin, " ", code, text1, text2, nullptr, nullptr,
                           nullptr, nullptr, nullptr, nullptr, -1, reason);
}
