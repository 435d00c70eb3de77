// Layouts of the shared trace control block, its records and their objects.
// A trace file is a byte image of the same structures, and other programs
// read both, so every size and offset below is fixed (little-endian, packed).
#pragma once

#include <cstddef>
#include <cstdint>

#include "common/env/klpenv.h"
#include "common/platform/hsv.h"
#include "common/trace/trace.h"

// ---------------------------------------------------------------------------
// Limits and fixed words
// ---------------------------------------------------------------------------
constexpr int TRC_COMPONENTS = 54;
constexpr int TRC_FUNCTIONS = 250;        // per component
constexpr int TRC_THREAD_SLOTS = 150;     // per thread table
constexpr int TRC_MODULES = 36;
constexpr int TRC_MAX_OBJECTS = 32;       // per data record
constexpr int TRC_NAME_CHARS = 15;        // data name, blank-padded
constexpr uint32_t TRC_HEADER_SIZE = 95264;
constexpr uint32_t TRC_RECORD_HEADER_SIZE = 40;
constexpr uint32_t TRC_OBJECT_HEADER_SIZE = 4;

constexpr uint32_t TRC_DEFAULT_BUFFER_SIZE = 2097152;
constexpr uint32_t TRC_MIN_SIZE = 131072;         // buffer and file size
constexpr uint32_t TRC_MAX_SIZE = 2147483647;     // buffer and file size
constexpr uint32_t TRC_DEFAULT_FILE_SIZE = 2147483647;

constexpr const char* TRC_PLATFORM = "Linux";
constexpr const char* TRC_STRUCT_VERSION = "0012";
constexpr const char* TRC_SYMBOL_VERSION = "0024";
constexpr int TRC_SYMBOL_VERSION_NUMBER = 24;
constexpr const char* TRC_RELEASE_NAME = "trace";
constexpr int TRC_VERSION = 8, TRC_RELEASE = 1, TRC_MODIFICATION = 0;

constexpr uint16_t TRC_APP_ATTACHED = 0xFFFF;     // application-attached flag
constexpr uint32_t TRC_FREE_KEY = 0xFFFFFFFF;     // a free thread data entry
constexpr uint16_t TRC_FILTER_OVERRIDE = 0x8000;  // filter word overrides
constexpr uint16_t TRC_FILTER_LEVELS = 0x000F;    // levels an override carries

// Record types.
enum : uint8_t {
  TRC_REC_ENTRY = 1,
  TRC_REC_EXIT = 2,
  TRC_REC_DATA = 3,
  TRC_REC_EXIT_VALUE = 4,  // exit with a return value object
};

// ---------------------------------------------------------------------------
// Layouts
// ---------------------------------------------------------------------------
#pragma pack(push, 1)

// Time value (16 bytes), as the platform clock gives it.
struct trcTimeValue {
  int64_t seconds;        // 0: since the epoch, UTC
  uint8_t unused[4];      // 8: no reader uses these
  int32_t microseconds;   // 12
};

// Thread-specific data entry (216 bytes).
struct trcThreadData {
  uint32_t threadId;      // 0
  char threadIdText[64];  // 4: "tid = 0x" and the id's four bytes in memory order
  char threadName[64];    // 68
  char data[80];          // 132
  uint32_t key;           // 212: the thread id; TRC_FREE_KEY when free
};

// The control block header (95264 bytes); the data area follows it from
// dataOffset to bufferSize. A trace file starts with the same header.
struct trcBlockHeader {
  char platform[16];                  // 0: "Linux"
  char structVersion[8];              // 16: "0012"
  char symbolVersion[8];              // 24: "0024"
  uint16_t componentCount;            // 32: 54
  uint16_t functionsPerComponent;     // 34: 250
  klpReleaseBlock traceRelease;       // 36: "trace" 8.1.0, unique name = key part 2
  uint32_t reserved1;                 // 268
  klpAppVersion appVersion;           // 272: the traced program's, zero when unknown
  trcTimeValue attachTime;            // 656: when the block was created
  uint16_t moduleCount;               // 672: at most 36
  klpModuleRecord modules[TRC_MODULES];  // 674
  uint8_t reserved2[6];               // 2258
  uint32_t dataOffset;                // 2264: data area from the block start; 95264
  uint32_t writeOffset;               // 2268: in the data area, where the next record goes
  uint32_t oldestOffset;              // 2272: the oldest record held
  uint32_t highWaterOffset;           // 2276: end of valid data beyond the write offset
  uint32_t entryCount;                // 2280: records held
  uint32_t maxFileSize;               // 2284
  uint32_t bufferSize;                // 2288: the whole block, header included
  char fileName[TRC_KEY_SIZE];        // 2292: trace file; empty when none
  uint16_t globalFilter;              // 3332: plain level mask
  uint8_t reserved3[6];               // 3334
  uint8_t bufferLock;                 // 3340: byte lock over the block
  uint8_t fileLock;                   // 3341: byte lock over writing the trace file
  uint8_t fileFull;                   // 3342: 1 once the trace file reached its maximum size
  uint8_t reserved4;                  // 3343
  uint32_t status;                    // 3344: a status word
  uint16_t componentFilters[TRC_COMPONENTS];                 // 3348
  uint16_t functionFilters[TRC_COMPONENTS][TRC_FUNCTIONS];   // 3456
  uint16_t appAttached;               // 30456: TRC_APP_ATTACHED while a server holds it
  uint16_t reserved5;                 // 30458
  trcThreadData threadTable[TRC_THREAD_SLOTS];     // 30460: hashed, slot = key mod 150
  trcThreadData threadOverflow[TRC_THREAD_SLOTS];  // 62860: filled in order
  uint32_t reserved6;                 // 95260
};

// Record header (40 bytes); the objects follow it. Lengths are multiples
// of 4.
struct trcRecordHeader {
  uint32_t length;        // 0: whole record
  uint16_t levelMask;     // 4: 1 for entry and exit
  uint16_t objectCount;   // 6
  uint16_t component;     // 8
  uint16_t function;      // 10
  int32_t pid;            // 12
  uint32_t threadId;      // 16
  union {
    trcTimeValue time;    // 20: entry and exit records
    char name[16];        // 20: data records, blank-padded to 15, byte 35 NUL
  };
  uint8_t type;           // 36: TRC_REC_*
  uint8_t unused[3];      // 37: left as the area held them
};

// Object header (4 bytes); the data follows, zero-padded to a multiple of 4.
struct trcObjectHeader {
  uint16_t type;
  uint16_t length;
};

#pragma pack(pop)

static_assert(sizeof(trcTimeValue) == 16 && offsetof(trcTimeValue, microseconds) == 12,
              "time value layout");
static_assert(sizeof(trcThreadData) == 216 && offsetof(trcThreadData, threadIdText) == 4 &&
                  offsetof(trcThreadData, threadName) == 68 &&
                  offsetof(trcThreadData, data) == 132 && offsetof(trcThreadData, key) == 212,
              "thread data entry layout");
static_assert(sizeof(trcRecordHeader) == TRC_RECORD_HEADER_SIZE &&
                  offsetof(trcRecordHeader, pid) == 12 &&
                  offsetof(trcRecordHeader, threadId) == 16 &&
                  offsetof(trcRecordHeader, time) == 20 && offsetof(trcRecordHeader, type) == 36,
              "record header layout");
static_assert(sizeof(trcObjectHeader) == TRC_OBJECT_HEADER_SIZE, "object header layout");
static_assert(sizeof(trcBlockHeader) == TRC_HEADER_SIZE, "control block header size");
static_assert(offsetof(trcBlockHeader, structVersion) == 16 &&
                  offsetof(trcBlockHeader, symbolVersion) == 24 &&
                  offsetof(trcBlockHeader, componentCount) == 32 &&
                  offsetof(trcBlockHeader, functionsPerComponent) == 34 &&
                  offsetof(trcBlockHeader, traceRelease) == 36 &&
                  offsetof(trcBlockHeader, reserved1) == 268 &&
                  offsetof(trcBlockHeader, appVersion) == 272 &&
                  offsetof(trcBlockHeader, attachTime) == 656 &&
                  offsetof(trcBlockHeader, moduleCount) == 672 &&
                  offsetof(trcBlockHeader, modules) == 674 &&
                  offsetof(trcBlockHeader, reserved2) == 2258,
              "control block header: version part");
static_assert(offsetof(trcBlockHeader, dataOffset) == 2264 &&
                  offsetof(trcBlockHeader, writeOffset) == 2268 &&
                  offsetof(trcBlockHeader, oldestOffset) == 2272 &&
                  offsetof(trcBlockHeader, highWaterOffset) == 2276 &&
                  offsetof(trcBlockHeader, entryCount) == 2280 &&
                  offsetof(trcBlockHeader, maxFileSize) == 2284 &&
                  offsetof(trcBlockHeader, bufferSize) == 2288 &&
                  offsetof(trcBlockHeader, fileName) == 2292 &&
                  offsetof(trcBlockHeader, globalFilter) == 3332 &&
                  offsetof(trcBlockHeader, reserved3) == 3334 &&
                  offsetof(trcBlockHeader, bufferLock) == 3340 &&
                  offsetof(trcBlockHeader, fileLock) == 3341 &&
                  offsetof(trcBlockHeader, fileFull) == 3342 &&
                  offsetof(trcBlockHeader, status) == 3344,
              "control block header: counters and locks");
static_assert(offsetof(trcBlockHeader, componentFilters) == 3348 &&
                  offsetof(trcBlockHeader, functionFilters) == 3456 &&
                  offsetof(trcBlockHeader, appAttached) == 30456 &&
                  offsetof(trcBlockHeader, threadTable) == 30460 &&
                  offsetof(trcBlockHeader, threadOverflow) == 62860 &&
                  offsetof(trcBlockHeader, reserved6) == 95260,
              "control block header: filters and thread tables");

// The first 2264 bytes of the header: version part, copied into trace files.
constexpr size_t TRC_VERSION_PART_SIZE = offsetof(trcBlockHeader, dataOffset);

// ---------------------------------------------------------------------------
// Small helpers over the layouts
// ---------------------------------------------------------------------------

// The data area of an image (block, copy, or a header followed by its data).
inline uint8_t* trcDataArea(trcBlockHeader* h) {
  return reinterpret_cast<uint8_t*>(h) + h->dataOffset;
}

// Byte locks of a block: buffer lock first, then file lock.
inline void trcLockBuffer(trcBlockHeader* h) { hsvByteLock(&h->bufferLock); }
inline void trcUnlockBuffer(trcBlockHeader* h) { hsvByteLockRelease(&h->bufferLock); }
inline void trcLockFile(trcBlockHeader* h) { hsvByteLock(&h->fileLock); }
inline void trcUnlockFile(trcBlockHeader* h) { hsvByteLockRelease(&h->fileLock); }

// Effective level of (component, function) from a header's filters: 0 out of
// range; a function override, else a component override (low four bits);
// else the global filter. Plain loads: filters change without the lock.
uint16_t trcFilterLevel(const trcBlockHeader* h, int component, int function);

// Record size of objectCount objects of the given data lengths: 40 plus,
// per object, 4 + its length rounded up to a multiple of 4.
uint32_t trcRecordSize(int objectCount, const uint32_t* lengths);

// "Initial", "Starting", "Running", "Stop", "Stopping", "Stopped", or
// "INVALID STATUS".
const char* trcStatusText(uint32_t word);

// Name of an object type; "UNKNOWN" for codes from TRC_OBJ_TYPE_COUNT on.
const char* trcObjectTypeName(unsigned type);

// "tid = 0x" and the id's four bytes in memory order as lower-case hex.
void trcThreadIdText(uint32_t threadId, char (&out)[64]);
