// The command engine: the server side of the command channel. A server's main
// thread runs it while the worker threads do the work. It takes requests from
// the server queue the process environment created, hands a MsgQe copy to
// every thread that declared interest in the request's code, answers the
// requester on its reply queue, supervises the threads, checks the database
// status every few seconds, turns a recorded signal into an orderly stop and
// runs the stop sequence.
#pragma once

#include <cstddef>
#include <cstdint>

class OrdList;

// Modes of cmdsEngine.
enum : int {
  CMDS_MODE_NORMAL = 0,
  CMDS_MODE_ONE_PASS = 2,  // one loop pass; the environment is not cleaned up
};

// Result codes of the engine beyond klprc.h.
enum : int {
  CMDS_RC_UNLOCK_FAILED = 1001,  // the thread list could not be unlocked while stopping
  CMDS_RC_DB_UNAVAILABLE = 929,
  CMDS_RC_DB_NOT_READY = 907,
  CMDS_RC_DB_QUIESCED = 928,
  CMDS_RC_RRS_UNAVAILABLE = 952,  // thread end code: RRS not available
  CMDS_RC_DB_DOWN = 2006,         // the loop's own result: database down, stop
};

constexpr int32_t CMDS_GRACE_SECONDS = 8;
constexpr int32_t CMDS_GRACE_SECONDS_XQAPPLY = 180;
constexpr int64_t CMDS_DB_CHECK_SECONDS = 4;  // a check is due once more than this passed
constexpr int32_t CMDS_GET_TIMEOUT_MS = 30000;
// A reply goes only when the requester's queue has room for its first
// message at once; the later pieces of a long reply may wait this long in
// all for the requester to make room.
constexpr int32_t CMDS_PIECE_WAIT_MS = 2000;
// Commands that may wait on one command list; a request past this is not
// handed to that list's thread (message 8054).
constexpr int32_t CMDS_MAX_PENDING_CMDS = 100;
constexpr int CMDS_MSG_CMD_REFUSED = 8054;
constexpr size_t CMDS_STATUS_TEXT_SIZE = 16;
constexpr const char* CMDS_STATUS_UNDETERMINED = "UNDETERMINED";

// The engine's working state for one call. Exposed so that the handling of
// one received message (cmdsHandleMessage) can be driven on its own.
struct cmdsState {
  int32_t mode;
  int32_t* stopRequested;  // caller's flag, set to 1 by a STOP request (may be null)
  int32_t stopping;        // the stop sequence has begun
  int64_t stopTime;        // UTC seconds when it began
  int32_t grace;           // seconds the stop sequence may last
  int64_t lastCheck;       // UTC seconds of the last database status check
  int32_t dbDown;          // a check reported the database unavailable
  int32_t endRequested;    // the loop must end
  int32_t endRc;           // result that ended the loop early (801, 1001), else 0
  int32_t getFailed;       // a get failed; cleared (message 517) by the next good one
  int32_t requester;       // senderPid of the request in hand
  char statusText[CMDS_STATUS_TEXT_SIZE];
  int highestEndCode;      // raised by supervision
  int32_t signalSeen;      // a recorded signal started the stop sequence
};

// Prepares a state for a call in `mode` (grace from the program name of the
// process environment).
void cmdsInitState(cmdsState* st, int mode, int32_t* stopRequested);

// The engine: loops until STOP, a signal or supervision ends it. threads may
// be null or empty. Answers 0, 804 (no server queue), 1001, 929 (database
// unavailable) or the highest thread end code (2011 counts as 0).
int cmdsEngine(OrdList* threads, int mode, int32_t* stopRequested);

// Handles one message exactly as it came off the server queue: `received`
// bytes at buf (nothing beyond them is read). Validates it, hands it to the
// interested threads, answers the requester and updates st. A message shorter
// than the header or whose length words disagree with what was received
// counts as a failed get. Answers 0, or 801 when an element could not be
// allocated (the loop then ends).
int cmdsHandleMessage(cmdsState* st, OrdList* threads, const void* buf, size_t received);

// The stop sequence: every thread not yet stopped receives a STOP element.
// Answers 0, 801 (an element could not be allocated) or 1001 (the list could
// not be unlocked). Nothing happens once stopping.
int cmdsStartStop(cmdsState* st, OrdList* threads);

// Database status check. A server without a database connection of its own
// installs the check it wants; it fills statusText (at most len - 1
// characters and a NUL) and answers 0, or 907, 928, 929 when the database is
// not available. Null restores the default check, which asks the calling
// thread's current connection.
typedef int (*cmdsDbStatusFn)(char* statusText, size_t len);
void cmdsSetDbStatusCheck(cmdsDbStatusFn fn);
int cmdsCheckDbStatus(int mode, char* statusText, size_t len);

// The STATUS reply for a thread list: 76 + 20 x (threads) bytes, records in
// list order from the head. Answers 0, 1003 or 2002 (no list). *out is freed
// with freeIpcMsg.
struct IpcMsg;
int recState(OrdList* threads, IpcMsg** out);
