// The command-channel message (IpcMsg) that travels between a command program
// and a server on their inter-process queues, the function codes it carries,
// how those queues are named, the server's reply and how long replies are cut
// into pieces and put together again; and the in-process element (MsgQe) into
// which the server's command engine turns a request for its threads.
//
// Everything read from a queue came from another process: decode it with
// ipcDecodeMsg (never cast a received buffer), which checks every length
// before anything is read.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstdio>

#include "common/platform/hsv.h"
#include "common/thread/ordlist.h"

// ---------------------------------------------------------------------------
// Message layout
// ---------------------------------------------------------------------------
constexpr size_t IPC_HEADER_SIZE = 44;
constexpr size_t IPC_MAX_MSG_SIZE = 4096;                             // one message, header included
constexpr size_t IPC_MAX_PAYLOAD = IPC_MAX_MSG_SIZE - IPC_HEADER_SIZE;  // 4052
constexpr int32_t IPC_MSG_VERSION = 1;
constexpr const char* IPC_EYE_CATCHER = "IPC:";

// The 44-byte header; the payload follows it. All integers little-endian.
struct IpcMsg {
  char eyeCatcher[8];   // "IPC:" and NUL bytes
  int32_t msgVersion;   // 1
  int32_t msgLength;    // whole message, header included
  int32_t func;         // function code
  int32_t subFunc;      // CHGPARMS: parameter index; otherwise 0
  int32_t senderPid;    // process that put the message
  int32_t reserved;     // 0
  int32_t pieceCount;   // replies: pieces of the reply (1 for one); requests: 0
  int32_t pieceNo;      // multi-piece replies: 1-based number; otherwise 0
  int32_t totalLength;  // multi-piece replies: payload bytes of all pieces; otherwise 0

  char* payload() { return reinterpret_cast<char*>(this) + IPC_HEADER_SIZE; }
  const char* payload() const { return reinterpret_cast<const char*>(this) + IPC_HEADER_SIZE; }
};
static_assert(sizeof(IpcMsg) == IPC_HEADER_SIZE, "IpcMsg header is 44 bytes");

// ---------------------------------------------------------------------------
// Function codes (a command's code is its parameter index in the command
// program's parameter set)
// ---------------------------------------------------------------------------
enum : int32_t {
  IPC_FUNC_TRCSTART = 10,
  IPC_FUNC_STOP = 14,
  IPC_FUNC_STATUS = 15,
  IPC_FUNC_RESERVED16 = 16,
  IPC_FUNC_QRYPARMS = 17,
  IPC_FUNC_RESUME = 18,
  IPC_FUNC_SUSPEND = 19,
  IPC_FUNC_CHGPARMS = 20,
  IPC_FUNC_REINIT = 21,
  IPC_FUNC_PRUNE = 22,
  IPC_FUNC_REINITQ = 23,
  IPC_FUNC_STARTQ = 24,
  IPC_FUNC_STOPQ = 25,
  IPC_FUNC_STATUS_SIZE = 59,     // "klpSISize: " and the thread count
  IPC_FUNC_KCAP_DETAILS = 60,    // answered by the server's interested thread
  IPC_FUNC_KAPP_DETAILS = 61,
  IPC_FUNC_KAPP_SIZE = 62,
  IPC_FUNC_FIRST_DISPATCHED = 10,
  IPC_FUNC_LAST_DISPATCHED = 62,
};

// True for the codes above.
bool ipcFuncKnown(int32_t func);
// Longest reply payload the code can need: STATUS 12 + 20 x 65536 (the thread
// count travels in 16 bits), QRYPARMS a query message of every slot at its
// longest value, the KCAP detailed status what its 16-bit offsets reach, the
// KAPP detailed status 4096 entries; every other code one message. A
// multi-piece reply names its own size, so this is what keeps a damaged or
// forged header from making the receiver allocate for it.
size_t ipcReplyPayloadLimit(int32_t func);
// The command word of a code ("STOP", ...), "" for codes without one.
const char* ipcFuncWord(int32_t func);

// STATUS reply: 12 bytes of header words (the third is the record count),
// then one 20-byte record per thread.
constexpr size_t IPC_STATUS_HEADER = 12;
constexpr size_t IPC_STATUS_RECORD = 20;
constexpr size_t IPC_STATUS_NAME = 16;
// Status size reply (59): "klpSISize: " with its NUL, then the count.
constexpr const char* IPC_SISIZE_TEXT = "klpSISize: ";
constexpr size_t IPC_SISIZE_TEXT_SIZE = 12;
constexpr size_t IPC_SISIZE_MSG_LENGTH = 60;

// ---------------------------------------------------------------------------
// Building and putting messages
// ---------------------------------------------------------------------------
// Allocates a reply of `size` bytes (44 + payload) with the header filled
// (pieceCount 1, everything else but func and senderPid 0) and the payload
// zeroed. Answers 0, 1003 after message 543 (out null), or 2002 when size is
// below 44. Free with freeIpcMsg.
int createReplyMsg(IpcMsg** out, size_t size, int32_t func, int32_t serverPid);

// Allocates a request: 44 bytes without text, 44 + length + 1 with one
// (text null: none). pieceCount 0. Answers 0, 1003, or 6005 when the text
// does not fit one message.
int createRequestMsg(IpcMsg** out, int32_t func, int32_t subFunc, const char* text);

void freeIpcMsg(IpcMsg* msg);

// Stamps the header as it is right before a put: "IPC:", version 1, this
// process's id, reserved 0.
void stampIpcMsg(IpcMsg* msg);

// Stamps msg and puts msgLength bytes on the attached queue. *platformRc gets
// the platform's code. Answers 0, or 503 when the put failed or msgLength is
// not within 44..4096 (nothing is put then; *platformRc is
// ECF_INVALID_ARGUMENT).
int putIpcMsg(HSVHIPCQueue* queue, IpcMsg* msg, hsvRC* platformRc);
// The same, waiting at most waitMs for room in a full queue (0: not at all;
// negative: as long as a plain put does). A queue still full gives 503 with
// *platformRc ECF_QUEUE_FULL.
int putIpcMsgWait(HSVHIPCQueue* queue, IpcMsg* msg, int32_t waitMs, hsvRC* platformRc);
constexpr int IPC_RC_PUT_FAILED = 503;

// Puts a reply of any length on the requester's attached queue: whole when
// its payload fits one message, otherwise in pieces (ipcBuildPiece), in
// order. The first message waits at most firstWaitMs for room, the pieces
// after it together at most restWaitMs (negative: each as long as a plain put
// does). After a failed put no further piece is sent. Answers 0, 503 (see
// *platformRc) or 1003 after message 543 (origin) when no piece buffer could
// be had. The reply itself is stamped but otherwise left as it is.
int putIpcReply(HSVHIPCQueue* queue, IpcMsg* reply, int32_t firstWaitMs, int32_t restWaitMs,
                hsvRC* platformRc, const char* origin);

// ---------------------------------------------------------------------------
// Decoding a received buffer
// ---------------------------------------------------------------------------
// A checked view of a received message: a copy of the header and where the
// payload lies in the caller's buffer.
struct IpcMsgView {
  IpcMsg header;
  const char* payload;   // null when payloadLen is 0
  size_t payloadLen;     // msgLength - 44
};

// Checks `received` bytes from a queue. Answers 0 with *view filled; 816 when
// the buffer is shorter than the header, its eye-catcher is not "IPC:" or its
// msgLength differs from what was received; 825 when msgVersion is not 1
// (*view still holds the header). Unknown function codes are not refused
// here: the engine answers them.
int ipcDecodeMsg(const void* buf, size_t received, IpcMsgView* view);

// Copies the payload as text into dst (dstSize > 0): up to its first NUL, the
// end of the payload or dstSize - 1 characters, whichever comes first, and a
// NUL. Answers the characters copied.
size_t ipcPayloadText(const IpcMsgView& view, char* dst, size_t dstSize);

// ---------------------------------------------------------------------------
// Multi-piece replies
// ---------------------------------------------------------------------------
// Pieces a reply payload of `payloadLen` bytes travels in (at least 1).
int32_t ipcPieceCount(size_t payloadLen);

// Writes piece `pieceNo` (1-based) of `reply` into out (capacity outCap, at
// least 4096 serves every piece): header copied from the reply, msgLength,
// piece fields set; a payload that fits one message goes whole with
// pieceCount 1, pieceNo 0 and totalLength 0. *outLen gets the piece's length.
// Answers 0 or 2002 (no such piece, damaged reply, out too small).
int ipcBuildPiece(const IpcMsg* reply, int32_t pieceNo, void* out, size_t outCap,
                  size_t* outLen);

// Collects reply pieces into one reply buffer: [int32 senderPid of the first
// piece][int32 payload bytes gathered][payload]. Single-piece replies are
// appended as they come (the buffer grows); the pieces of a multi-piece reply
// must agree with its first piece in code, count and total, come in order
// (pieceNo 1, 2, ...) and sum to the total, which must lie within what the
// code can need (ipcReplyPayloadLimit). Room grows with the pieces that came,
// never ahead of them by more than what has come.
class IpcGather {
 public:
  IpcGather() = default;
  ~IpcGather();
  IpcGather(const IpcGather&) = delete;
  IpcGather& operator=(const IpcGather&) = delete;

  // Takes one decoded message. Answers 0, 1003 when memory ran out, or 816
  // when the piece is inconsistent (nothing of it is kept; the gather is
  // spoiled and refuses everything after). *piecesLeft gets the pieces still
  // expected of the reply in progress (0 when it is complete).
  int add(const IpcMsgView& msg, int32_t* piecesLeft);
  // Pieces still expected of the reply in progress.
  int32_t outstanding() const { return expected_ - received_; }
  // Payload bytes gathered so far, and the room held for them.
  size_t gathered() const { return used_; }
  size_t reserved() const { return capacity_; }
  // Hands the buffer (malloc'ed; the caller frees it) to the caller; null
  // when nothing was gathered or the gather is spoiled.
  char* release();

 private:
  int reserve(size_t payloadBytes, size_t ceiling);
  char* buf_ = nullptr;
  size_t capacity_ = 0;   // payload capacity of buf_
  size_t used_ = 0;
  int32_t expected_ = 0;  // pieces of the multi-piece reply in progress
  int32_t received_ = 0;
  int32_t total_ = 0;
  int32_t func_ = 0;      // code of the multi-piece reply in progress
  size_t base_ = 0;       // where the multi-piece reply in progress begins
  bool spoiled_ = false;
};
constexpr size_t IPC_GATHER_HEADER = 8;

// ---------------------------------------------------------------------------
// Queue naming
// ---------------------------------------------------------------------------
// "%s%s.IPC" of the IPC directory and the server's name (null: none).
// Answers 0, or 6005 when it does not fit (out then empty).
int ipcServerQueuePath(char* out, size_t outLen, const char* ipcDir, const char* serverName);
// "%s%s.IPC.CMD%d" of the same and the requester's process id.
int ipcReplyQueuePath(char* out, size_t outLen, const char* ipcDir, const char* serverName,
                      int32_t requesterPid);
// The same two, from the process environment's IPC directory and name
// prefix (left out while it is not set).
int ipcEnvServerQueuePath(char* out, size_t outLen);
int ipcEnvReplyQueuePath(char* out, size_t outLen, int32_t requesterPid);

// The printable form "(%s, %s, %s)" of a resource id as a malloc'ed text
// (null when memory ran out); "UNKNOWN" for a null id.
char* ipcNewResIDText(const HSVResID* id);
constexpr const char* IPC_RESID_UNKNOWN = "UNKNOWN";

// Program words by the last dot-separated part of a server name: "Capture",
// "Apply", "K Capture", "K Apply", "Monitor", otherwise "*"; and the server
// side's "Capture Commands" ... "Monitor Commands", otherwise "*".
const char* ipcProgramWord(const char* serverName);
const char* ipcProgramCmdWord(const char* serverName);

// ---------------------------------------------------------------------------
// MsgQe: a request handed to an interested server thread
// ---------------------------------------------------------------------------
constexpr size_t MSGQE_STRING_SIZE = 1040;  // 1039 characters and NUL
constexpr const char* MSGQE_EYE_CATCHER = "ITC:";

struct MsgQe {
  OrdListElement ole;          // eye-catcher "ITC:", size 64
  int32_t QeFunc;
  int32_t QeSubFunc;
  int32_t QeSubFuncInfo;       // 0 at creation; the receiving thread's own
  int32_t QeResponseId;        // requester's process id: names the reply queue
  char QeString[MSGQE_STRING_SIZE];
  uint64_t replyTag;           // 0 at creation; the receiving thread's own
};
static_assert(sizeof(MsgQe) == 1128, "MsgQe layout");

// Builds the element for a decoded request. With a requester the payload's
// bytes are copied as they are, without one as a text; either way cut to
// 1039 characters and NUL-terminated. Answers 0, or 801 after message 543
// ("1128", "MsgQe") with *out null.
int createMsgQe(MsgQe** out, const IpcMsgView& request);
// An element carrying only a function code (everything else 0): the stop
// sequence's request to the threads. Null after message 543.
MsgQe* createMsgQeFunc(int32_t func);
void deleteMsgQe(MsgQe* qe);
void setMsgQeReplyTag(MsgQe* qe, uint64_t tag);
// Diagnostic print of the element to standard output.
void printMsgQe(const MsgQe* qe);
