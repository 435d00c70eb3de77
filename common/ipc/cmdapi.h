// Command client: the requesting side of the command channel. It attaches to
// a server's queue, creates a private reply queue, puts one command (or one
// per changed parameter), polls for the replies and either prints them or
// hands their payload to the caller. Also the reply sender used by server
// threads, and the status collector behind the exported control interface.
#pragma once

#include <cstddef>
#include <cstdint>

#include "common/platform/hsv.h"
#include "include/klpapi.h"

struct IpcMsg;

// Result codes of this module beyond klprc.h.
enum : int {
  KLP_RC_PRINT_FAILED = 817,       // a reply could not be printed
};

// Function code that sends nothing: the call only proves the server is
// reachable.
constexpr int KLP_FUNC_NONE = -1;

// Bounds of the wait for replies.
constexpr int KLP_CMD_POLLS = 16;            // empty polls before giving up (824)
constexpr int32_t KLP_CMD_PAUSE_MS = 2001;   // longest pause between polls
constexpr int32_t KLP_CMD_GET_TIMEOUT_MS = 30000;
constexpr int KLP_ATTACH_ATTEMPTS = 5;

// Message capture buffer: while one is passed to cmdAPIFunc, the texts of the
// messages issued during the call are collected here (separated by a line
// feed, at most 1024 characters, always NUL-terminated) instead of printed.
constexpr int KLP_CAPTURE_CHARS = 1024;
struct klpMsgCapture {
  uint16_t length;                     // characters in text
  char text[KLP_CAPTURE_CHARS + 2];
};

// Reply buffer handed to a caller of cmdAPIFunc (malloc'ed; the caller frees
// it): int32 senderPid of the first piece, int32 payload byte count, payload.
constexpr size_t KLP_REPLY_HEADER = 8;

// Sends function code `func` to the server whose name (prefix) is serverName.
// payload: request text or null. replyBuf: when given, the reply payload is
// gathered into a new buffer stored there (null on failure) instead of being
// printed. capture: see klpMsgCapture. A reply whose function code is not
// func is dropped (a late answer to an earlier call). One call at a time
// runs in a process; another thread's call waits for it. Answers 0, 804,
// 805, 815, 816, 817, 824, 825 or 1003.
int cmdAPIFunc(const char* serverName, int func, const char* payload, char** replyBuf,
               klpMsgCapture* capture);

// Attaches queue to the queue at path, up to 5 attempts with pauses of
// 2001 ms. resId receives the printable resource id ("UNKNOWN" when none);
// *platformRc the last platform code (0 when none). Answers 0 or 815.
int KLPAttachIPCQ(HSVHIPCQueue* queue, char* resId, size_t resIdLen, const char* path,
                  hsvRC* platformRc);

// Answers a request from process requesterPid: the reply message (header and
// payload, msgLength bytes, any length) goes to that requester's reply queue,
// in pieces of at most 4052 payload bytes when longer. The caller keeps the
// message. Answers 0, 805, 815 or 1003.
int KLPResponseFunc(int32_t requesterPid, IpcMsg* reply);

// The command program's command: the COMMAND parameter named on the command
// line (none: -1) is sent to the environment's name prefix and the replies
// are printed.
int KLPCmdFunc();

// Sends STATUS to the server "name.suffix" and prints the reply; 2009 when
// that name does not fit a server name.
int KLPMonFunc(const char* name, const char* suffix, klpMsgCapture* capture);

// The status collector behind klpGetStatus; the command program calls it
// directly for STATUS SHOW DETAILS with no capture and request->bufferSize 0,
// and then frees request->buffer.
int klpCollectStatus(const klpReleaseInfo* release, klpStatusRequest* request,
                     klpResultBlock* result, klpMsgCapture* capture);

// The status size of a reply to the status size query (59, or 62 for
// KAPP): "klpSISize: " with its NUL, then the thread count, gives the size
// status format 1 (format 2 for KAPP) needs. Answers 0, or 2017 when the
// reply is no such answer (message issued).
int klpStatusSizeFromReply(int32_t kind, const char* reply, int32_t* size,
                           klpMsgCapture* capture);

// Runs the prologue of the process's main thread object while it is still in
// state 1, so that a caller of the control interface is a known thread.
void klpEnsureMainThread();

// ---------------------------------------------------------------------------
// Pieces exposed for the exported functions and the tests.
// ---------------------------------------------------------------------------

// Builds "SERVER.SCHEMA.KIND" from the caller's name fields (at most 128
// characters each, ended by a blank or NUL, upper-cased; a trailing "." of
// the schema is dropped). Answers 0, 2007 (empty server), 2008 (empty
// schema), 2006 (bad kind) or 2009 (does not fit out).
int klpBuildServerName(int32_t kind, const char* server, const char* schema, char* out,
                       size_t outLen);

// Prints a STATUS reply payload: message 520 per thread with its name and
// state. Answers 0, or 817 when the payload holds fewer records than it
// claims (nothing is printed then).
int printState(const char* payload, size_t len, klpMsgCapture* capture);

// Maps a cmdAPIFunc code to the control interface's code.
int klpMapCmdRc(int rc);

// The thread kind of format 1 for a thread name of the STATUS reply.
int32_t klpThreadKind(const char* name);

// Converting a reply payload into status data. payload/len: the gathered
// payload. out/outLen: the caller's buffer (may be null when outLen is 0).
// *required receives the size the data needs. Answers 0, 1001 (buffer too
// small) or 2017 (the payload does not hold what its counts, offsets and
// lengths claim; nothing is filled then).
int klpStatusFromThreads(const char* payload, size_t len, char* out, size_t outLen,
                         int32_t* required);
int klpStatusFromKcap(const char* payload, size_t len, char* out, size_t outLen,
                      int32_t* required);
int klpStatusFromKapp(const char* payload, size_t len, char* out, size_t outLen,
                      int32_t* required);
