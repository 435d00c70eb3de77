// Trace points. Every traced function marks its entry, exit and data with
// these. While the process's trace anchor is not Running a point costs one
// load of the anchor's state and a branch, taken inline before any call, and
// answers 0.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <type_traits>

class HSVHIPCMemory;
struct trcBlockHeader;

// Status words: the anchor's state and the control block's status.
enum : uint32_t {
  TRC_STATE_INITIAL = 0x11111111,
  TRC_STATE_STARTING = 0x0F1E2D3C,
  TRC_STATE_RUNNING = 0x4B5A6978,
  TRC_STATE_STOP = 0x33333333,
  TRC_STATE_STOPPING = 0x77777777,
  TRC_STATE_STOPPED = 0xFFFFFFFF,
};

// Return kinds of trcExit.
enum : int { TRC_RET_NONE = 0, TRC_RET_RC = 1, TRC_RET_BOOL = 2, TRC_RET_PTR = 3 };

// Level bits of a record's level mask and of the filters.
enum : uint16_t {
  TRC_LVL_FLOW = 1,     // level 1: entry and exit
  TRC_LVL_BASIC = 2,    // level 2
  TRC_LVL_DETAIL = 4,   // level 3
  TRC_LVL_PERF = 8,     // level 4
  TRC_LVL_SQL = 16,     // level 5
  TRC_LVL_XQ = 32,      // level 6
};

// Object types; codes from TRC_OBJ_TYPE_COUNT on are unknown.
enum : uint16_t {
  TRC_OBJ_RAW = 0,
  TRC_OBJ_SIGNED = 1,
  TRC_OBJ_TRCSTRING = 2,
  TRC_OBJ_STRING = 3,
  TRC_OBJ_SQLCA = 4,
  TRC_OBJ_SQLDA = 5,
  TRC_OBJ_SQLSTMT = 6,
  TRC_OBJ_NAME = 7,
  TRC_OBJ_ORDLIST = 8,
  TRC_OBJ_ORDLIST_ELEMENT = 9,
  TRC_OBJ_ORDLIST_ELEMENT_ADDR = 10,
  TRC_OBJ_XQ_ELEMENT = 11,
  TRC_OBJ_THREAD = 12,
  TRC_OBJ_RC = 13,
  TRC_OBJ_TRANS = 14,
  TRC_OBJ_NULL = 15,
  TRC_OBJ_UNSIGNED = 16,
  TRC_OBJ_BOOL = 17,
  TRC_OBJ_POINTER = 18,
  TRC_OBJ_TIMESTAMP = 19,
  TRC_OBJ_GTRAN = 20,
  TRC_OBJ_SQLSTMT_TYPE = 21,
  TRC_OBJ_ADMIN_MSG_TYPE = 22,
  TRC_OBJ_TYPE_COUNT = 23,
};

constexpr size_t TRC_KEY_SIZE = 1040;  // each key part, NUL included

// The trace anchor: one per process, 2112 bytes. The state word is read
// without a lock by every trace point; block and state change only through
// the attachment functions (trace_anchor.h).
struct trcAnchor {
  HSVHIPCMemory* memory;        // 0: the shared block this process holds, or null
  trcBlockHeader* block;        // 8: its address while attached, or null
  int32_t pid;                  // 16: written into every record
  char keyPart1[TRC_KEY_SIZE];  // 20: the IPC directory
  char keyPart2[TRC_KEY_SIZE];  // 1060: the server's name prefix
  uint32_t state;               // 2100: a status word
  FILE* out;                    // 2104: messages and formatted lines; null: stdout
};
static_assert(sizeof(trcAnchor) == 2112, "trace anchor layout");
static_assert(offsetof(trcAnchor, pid) == 16 && offsetof(trcAnchor, keyPart1) == 20 &&
                  offsetof(trcAnchor, keyPart2) == 1060 && offsetof(trcAnchor, state) == 2100 &&
                  offsetof(trcAnchor, out) == 2104,
              "trace anchor offsets");

// The anchor's static storage. Other code reaches it through trcGetAnchor();
// the trace points read its state directly, which keeps the disabled path at
// one load.
extern trcAnchor g_trcAnchorStorage;

inline uint32_t trcAnchorState() {
  return __atomic_load_n(&g_trcAnchorStorage.state, __ATOMIC_RELAXED);
}
inline bool trcIsRunning() { return trcAnchorState() == TRC_STATE_RUNNING; }

// Bodies behind the inline gates below; each checks the state again.
uint32_t trcLevelBody(int component, int function);
uint32_t trcEntryBody(int component, int function);
void trcExitBody(int component, int function, int returnKind, int16_t value16, int32_t value32,
                 int64_t value64);

// Effective level mask of (component, function); 0 while tracing is off.
inline uint32_t trcLevel(int component, int function) {
  return trcIsRunning() ? trcLevelBody(component, function) : 0;
}
// Writes an entry record when level 1 is enabled; answers the level.
inline uint32_t trcEntry(int component, int function) {
  return trcIsRunning() ? trcEntryBody(component, function) : 0;
}
// Writes an exit record when level 1 is enabled: kind TRC_RET_RC adds the
// 16-bit value as a return code, TRC_RET_BOOL the 32-bit value as a boolean,
// TRC_RET_PTR the 64-bit value as a pointer.
inline void trcExit(int component, int function, int returnKind, int16_t value16 = 0,
                    int32_t value32 = 0, int64_t value64 = 0) {
  if (trcIsRunning()) trcExitBody(component, function, returnKind, value16, value32, value64);
}
// The exit of a routine that answers a code: its record carries the code.
inline void trcExitRc(int component, int function, int32_t rc) {
  trcExit(component, function, TRC_RET_RC, static_cast<int16_t>(rc));
}

// Common body of the trcData family: up to 32 objects (more are ignored).
uint32_t trcDataN(int component, int function, const char* dataName, uint32_t levelMask,
                  int objectCount, const int* types, const uint32_t* lengths,
                  const void* const* pointers);

// trcData with 1 to 9 objects, each given as (type, length, pointer). Writes
// a data record when levelMask shares a bit with the effective level.
template <typename... Rest>
inline uint32_t trcData(int component, int function, const char* dataName, uint32_t levelMask,
                        int type, uint32_t length, const void* pointer, Rest... rest) {
  static_assert(sizeof...(Rest) % 3 == 0 && sizeof...(Rest) / 3 <= 8,
                "trcData takes 1 to 9 (type, length, pointer) objects");
  if (!trcIsRunning()) return 0;
  constexpr int n = 1 + static_cast<int>(sizeof...(Rest)) / 3;
  int types[n];
  uint32_t lengths[n];
  const void* pointers[n];
  types[0] = type;
  lengths[0] = length;
  pointers[0] = pointer;
  if constexpr (sizeof...(Rest) > 0) {
    int i = 1, k = 0;
    auto take = [&](auto v) {
      if constexpr (std::is_pointer_v<decltype(v)> || std::is_null_pointer_v<decltype(v)>) {
        pointers[i++] = static_cast<const void*>(v);
        k = 0;
      } else if (k == 0) {
        types[i] = static_cast<int>(v);
        k = 1;
      } else {
        lengths[i] = static_cast<uint32_t>(v);
      }
    };
    (take(rest), ...);
  }
  return trcDataN(component, function, dataName, levelMask, n, types, lengths, pointers);
}
