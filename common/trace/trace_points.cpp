// Trace points and the writer under them. A point first checks the anchor's
// state inline (trace.h); only while Running does it come here, compute the
// effective level from the block's filters and, when its bit is set, build
// the record directly in the shared data area under the buffer lock.
#include <algorithm>
#include <atomic>
#include <cstdlib>
#include <cstring>

#include "common/trace/trace.h"
#include "common/trace/trc_internal.h"
#include "common/trace/trcblock.h"
#include "common/trace/trcwrite.h"

trcAnchor g_trcAnchorStorage;

namespace {

inline void fillTime(trcTimeValue* t) {
  HSVTimeUTC now = hsvTimeGetUTC();
  memset(t, 0, sizeof *t);
  t->seconds = now.seconds;
  t->microseconds = now.microseconds;
}

// The data area's counters are shared with other processes: before the
// writer steps by their lengths it makes sure they describe the area.
bool countersSound(const trcBlockHeader* b, size_t mapped) {
  uint64_t area = static_cast<uint64_t>(b->bufferSize) - b->dataOffset;
  return b->dataOffset >= TRC_HEADER_SIZE && b->bufferSize <= mapped &&
         b->dataOffset <= b->bufferSize && b->highWaterOffset <= area &&
         b->writeOffset <= b->highWaterOffset && b->oldestOffset <= b->highWaterOffset;
}

// Length of the record at off, or 0 when it cannot be a record ending by end.
uint32_t lengthAt(const uint8_t* data, uint32_t off, uint32_t end) {
  uint32_t len;
  if (off > end || end - off < TRC_RECORD_HEADER_SIZE) return 0;
  memcpy(&len, data + off, sizeof len);
  if (len < TRC_RECORD_HEADER_SIZE || (len & 3) != 0 || len > end - off) return 0;
  return len;
}

// A damaged area cannot be stepped through: start it afresh rather than
// write over records whose extent is unknown.
void emptyArea(trcBlockHeader* b) {
  b->writeOffset = b->oldestOffset = b->highWaterOffset = b->entryCount = 0;
}

// Steps 4 and 5 of an append: wrap when the record does not fit at the write
// offset, then drop the oldest records it would overwrite. Answers the
// private copy to flush (direct-to-file mode), or null.
trcBlockHeader* makeRoom(trcBlockHeader* b, uint32_t len) {
  uint8_t* data = trcDataArea(b);
  trcBlockHeader* copy = nullptr;
  if (static_cast<uint64_t>(b->dataOffset) + b->writeOffset + len > b->bufferSize) {
    if (b->oldestOffset >= b->writeOffset && b->oldestOffset < b->highWaterOffset) {
      // Records beyond the write offset from the previous lap are dropped.
      uint32_t off = b->oldestOffset;
      while (off < b->highWaterOffset && b->entryCount > 0) {
        uint32_t rl = lengthAt(data, off, b->highWaterOffset);
        if (rl == 0) {
          emptyArea(b);
          break;
        }
        off += rl;
        --b->entryCount;
      }
    }
    b->oldestOffset = 0;
    b->highWaterOffset = b->writeOffset;
    if (b->fileName[0] != '\0') {
      trcLockFile(b);
      copy = trcCopyBlock(b);
      if (copy == nullptr) {
        trcFlushLap(b, b);
        trcUnlockFile(b);
      }
    }
    b->writeOffset = 0;
  }
  if (b->entryCount != 0 && b->oldestOffset >= b->writeOffset) {
    while (b->writeOffset + len > b->oldestOffset) {
      uint32_t rl = lengthAt(data, b->oldestOffset, b->highWaterOffset);
      if (rl == 0) {
        emptyArea(b);
        break;
      }
      b->oldestOffset += rl;
      --b->entryCount;
      if (b->oldestOffset >= b->highWaterOffset || b->entryCount == 0) {
        b->oldestOffset = 0;
        break;
      }
    }
  }
  return copy;
}

// Builds the record at the write offset; the size was computed from the
// same lengths, so every object fits.
void buildRecord(trcBlockHeader* b, int component, int function, uint16_t levelMask,
                 const void* timeOrName, uint8_t type, uint32_t len, int count,
                 const int* types, const uint32_t* lengths, const void* const* pointers) {
  uint8_t* rec = trcDataArea(b) + b->writeOffset;
  trcRecordHeader h;
  h.length = len;
  h.levelMask = levelMask;
  h.objectCount = static_cast<uint16_t>(count);
  h.component = static_cast<uint16_t>(component);
  h.function = static_cast<uint16_t>(function);
  h.pid = g_trcAnchorStorage.pid;
  h.threadId = trcint::threadId();
  memcpy(&h.time, timeOrName, sizeof h.time);
  h.type = type;
  memcpy(rec, &h, offsetof(trcRecordHeader, unused));  // bytes 37..39 are left as they were
  uint32_t off = TRC_RECORD_HEADER_SIZE;
  for (int i = 0; i < count; ++i) {
    uint32_t dataLen = lengths[i];
    uint32_t padded = (dataLen + 3) & ~3u;
    if (off + TRC_OBJECT_HEADER_SIZE + padded > len) break;
    trcObjectHeader oh;
    uint16_t declared = static_cast<uint16_t>(types[i]);
    const void* src = pointers[i];
    if (src == nullptr) {
      oh.type = TRC_OBJ_NULL;
      src = &declared;
    } else {
      oh.type = declared;
    }
    oh.length = static_cast<uint16_t>(dataLen);
    memcpy(rec + off, &oh, sizeof oh);
    off += TRC_OBJECT_HEADER_SIZE;
    memcpy(rec + off, src, dataLen);
    memset(rec + off + dataLen, 0, padded - dataLen);
    off += padded;
  }
}

void writeRecord(trcBlockHeader* b, int component, int function, uint16_t levelMask,
                 const void* timeOrName, uint8_t type, uint32_t len, int count, const int* types,
                 const uint32_t* lengths, const void* const* pointers) {
  trcLockBuffer(b);
  if (b->status == TRC_STATE_STOP || !countersSound(b, trcint::mappedSize()) ||
      static_cast<uint64_t>(b->dataOffset) + len > b->bufferSize) {
    trcUnlockBuffer(b);
    return;
  }
  trcBlockHeader* copy = makeRoom(b, len);
  buildRecord(b, component, function, levelMask, timeOrName, type, len, count, types, lengths,
              pointers);
  b->writeOffset += len;
  b->highWaterOffset = std::max(b->highWaterOffset, b->writeOffset);
  ++b->entryCount;
  trcUnlockBuffer(b);
  if (copy != nullptr) {
    // The block stays mapped while this thread is inside it, so its file
    // lock can always be released here.
    trcFlushLap(b, copy);
    trcUnlockFile(b);
    free(copy);
  }
}

}  // namespace

trcBlockHeader* trcCopyBlock(const trcBlockHeader* block) {
  uint32_t size = block->bufferSize;
  if (size < TRC_HEADER_SIZE || size > trcint::mappedSize()) return nullptr;
  auto* copy = static_cast<trcBlockHeader*>(malloc(size));
  if (copy != nullptr) memcpy(copy, block, size);
  return copy;
}

void trcFlushLastLap(trcBlockHeader* block) {
  trcLockBuffer(block);
  trcBlockHeader* copy = trcCopyBlock(block);
  trcLockFile(block);
  if (copy != nullptr) {
    trcUnlockBuffer(block);
    trcFlushLap(block, copy);
    free(copy);
  } else if (block->bufferSize <= trcint::mappedSize()) {
    trcFlushLap(block, block);
  }
  trcUnlockFile(block);
  if (copy == nullptr) trcUnlockBuffer(block);
}

uint32_t trcLevelBody(int component, int function) {
  trcBlockHeader* b = trcint::enterBlock();
  if (b == nullptr) return 0;
  uint32_t level = trcFilterLevel(b, component, function);
  trcint::leaveBlock();
  return level;
}

uint32_t trcEntryBody(int component, int function) {
  trcBlockHeader* b = trcint::enterBlock();
  if (b == nullptr) return 0;
  uint32_t level = trcFilterLevel(b, component, function);
  if (level & TRC_LVL_FLOW) {
    trcTimeValue t;
    fillTime(&t);
    writeRecord(b, component, function, TRC_LVL_FLOW, &t, TRC_REC_ENTRY, TRC_RECORD_HEADER_SIZE,
                0, nullptr, nullptr, nullptr);
  }
  trcint::leaveBlock();
  return level;
}

void trcExitBody(int component, int function, int returnKind, int16_t value16, int32_t value32,
                 int64_t value64) {
  trcBlockHeader* b = trcint::enterBlock();
  if (b == nullptr) return;
  if (trcFilterLevel(b, component, function) & TRC_LVL_FLOW) {
    trcTimeValue t;
    fillTime(&t);
    int type = 0;
    uint32_t length = 0;
    const void* value = nullptr;
    if (returnKind == TRC_RET_RC) {
      type = TRC_OBJ_RC;
      length = sizeof value16;
      value = &value16;
    } else if (returnKind == TRC_RET_BOOL) {
      type = TRC_OBJ_BOOL;
      length = sizeof value32;
      value = &value32;
    } else if (returnKind == TRC_RET_PTR) {
      type = TRC_OBJ_POINTER;
      length = sizeof value64;
      value = &value64;
    }
    if (value != nullptr) {
      writeRecord(b, component, function, TRC_LVL_FLOW, &t, TRC_REC_EXIT_VALUE,
                  trcRecordSize(1, &length), 1, &type, &length, &value);
    } else {
      writeRecord(b, component, function, TRC_LVL_FLOW, &t, TRC_REC_EXIT, TRC_RECORD_HEADER_SIZE,
                  0, nullptr, nullptr, nullptr);
    }
  }
  trcint::leaveBlock();
}

uint32_t trcDataN(int component, int function, const char* dataName, uint32_t levelMask,
                  int objectCount, const int* types, const uint32_t* lengths,
                  const void* const* pointers) {
  trcBlockHeader* b = trcint::enterBlock();
  if (b == nullptr) return 0;
  uint32_t level = trcFilterLevel(b, component, function);
  if ((level & levelMask) != 0 && objectCount > 0) {
    int n = std::min(objectCount, TRC_MAX_OBJECTS);
    // A null pointer is stored as its declared type (2 bytes); an object
    // length has 16 bits in the record.
    uint32_t lens[TRC_MAX_OBJECTS];
    for (int i = 0; i < n; ++i)
      lens[i] = pointers[i] == nullptr ? 2u : std::min<uint32_t>(lengths[i], UINT16_MAX);
    char name[16];
    memset(name, ' ', TRC_NAME_CHARS);
    name[TRC_NAME_CHARS] = '\0';
    if (dataName != nullptr) memcpy(name, dataName, strnlen(dataName, TRC_NAME_CHARS));
    writeRecord(b, component, function, static_cast<uint16_t>(levelMask), name, TRC_REC_DATA,
                trcRecordSize(n, lens), n, types, lens, pointers);
  }
  trcint::leaveBlock();
  return level;
}
