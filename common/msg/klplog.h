// Process-wide issuing of numbered messages over the process logger.
// Every subsystem reports through these; the logger itself (msgLogger,
// msgLoggerU) lives in msglogger.h.
#pragma once

#include <cstdint>

class msgLogger;

// The process logger: created first thing by each program, used by all.
msgLogger* klpGetProcessLogger();
void klpSetProcessLogger(msgLogger* logger);

// Context of logKlpMsg: either capture the composed text instead of issuing
// it (wantText != 0: text goes to buffer as a 16-bit length followed by the
// characters, at most bufferChars of them), or carry two integers that travel
// with the message as its extra pair.
struct klpMsgCtx {
  int32_t wantText;
  int32_t extra1;
  int32_t extra2;
  uint16_t bufferChars;  // capacity of the text part of buffer
  char* buffer;          // [uint16_t length][characters...]
};

// Destination kinds: 0 log file (and console with LOGSTDOUT), 2 console always
// plus the severity's routing, anything else routing by severity.
enum : int { KLP_DEST_LOG = 0, KLP_DEST_SEVERITY = 1, KLP_DEST_CONSOLE = 2 };

// Issues message `number` with the values firstValue and `count` further
// const char* arguments (the first nine values are kept; absent ones become
// " "). Number -1 issues message 8999 with firstValue as its only value.
// A text asked for through the context is composed even when the process
// has no logger (a library caller's process), by a logger of the library's
// own that is never published.
// Answers 0, or the record's error (801) when the message was lost.
int logKlpMsg(int number, const char* origin, int destKind, const char* firstValue,
              klpMsgCtx* context, int count, ...);

// The internal error: message 589 (origin, rc as "%d", the failing operation)
// and, when detail is given, message 8999 with it at routing 8.
void logInternalError(const char* origin, int rc, const char* operation,
                      const char* detail = nullptr);
