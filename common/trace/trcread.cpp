// Record and object iteration over a block image or a trace file, and the
// checks that keep a damaged or hostile trace from leading a reader outside
// the bytes it holds or round in circles.
#include "common/trace/trcread.h"

#include <sys/stat.h>
#include <sys/types.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

namespace {

constexpr size_t kFirstBufferSize = 1024;

// Bytes of records the counters say are held.
uint64_t bytesHeld(const trcBlockHeader* h) {
  if (h->oldestOffset < h->writeOffset) return h->writeOffset - h->oldestOffset;
  return static_cast<uint64_t>(h->highWaterOffset - h->oldestOffset) + h->writeOffset;
}

void finish(trcIter* it, int error) {
  it->done = true;
  it->error = error;
  it->record = nullptr;
  trcIterEnd(it);
}

// The end of the stretch of records the current offset lies in.
uint32_t stretchEnd(const trcIter* it) {
  return it->wrapped || it->oldestOffset < it->writeOffset ? it->writeOffset : it->highWater;
}

bool badRecord(trcIter* it, uint32_t length) {
  fprintf(trcOut(),
          "Record %d at offset %u has an impossible length %u; the rest of the trace is not "
          "read.\n",
          it->number, it->offset, length);
  finish(it, TRC_WALK_BAD_RECORD);
  return false;
}

bool ioFailure(trcIter* it, const char* fmt) {
  fprintf(trcOut(), fmt, it->number);
  finish(it, TRC_WALK_IO);
  return false;
}

// Whether the file holds `end` bytes. A trace written to file may grow while
// it is read, so its size is looked at again before a record is refused.
bool fileHolds(trcIter* it, uint64_t end) {
  if (end <= it->fileSize) return true;
  struct stat st;
  if (fstat(fileno(it->file), &st) == 0 && st.st_size > 0) it->fileSize = static_cast<uint64_t>(st.st_size);
  return end <= it->fileSize;
}

bool readFromFile(trcIter* it, uint32_t room) {
  uint64_t pos = static_cast<uint64_t>(it->dataOffset) + it->offset;
  // Records follow each other in the file: seek only where they do not, as
  // a seek costs a system call even when the stream's buffer holds the bytes.
  if (pos != it->filePos && fseeko(it->file, static_cast<off_t>(pos), SEEK_SET) != 0) {
    int err = errno;
    fprintf(trcOut(),
            "Unable to set file position in file \"%s\" to read next data record,\nfseek() "
            "error:  \"%d\", reason:  \"%s\".\n",
            it->header->fileName, err, strerror(err));
    finish(it, TRC_WALK_IO);
    return false;
  }
  if (fread(it->buffer, 1, TRC_RECORD_HEADER_SIZE, it->file) != TRC_RECORD_HEADER_SIZE)
    return ioFailure(it, "Error reading record %d.\n");
  uint32_t length;
  memcpy(&length, it->buffer, sizeof length);
  // The counters of a damaged header may claim gigabytes: a length is taken
  // only as far as the file holds it, before any memory is sized by it.
  if (length < TRC_RECORD_HEADER_SIZE || (length & 3) != 0 || length > room ||
      !fileHolds(it, pos + length))
    return badRecord(it, length);
  if (length > it->bufferSize) {
    size_t grown = it->bufferSize * 2 > length ? it->bufferSize * 2 : length;
    uint8_t* bigger = static_cast<uint8_t*>(realloc(it->buffer, grown));
    if (bigger == nullptr) {
      printf("Unable to get memory to read record %d.\n", it->number);
      finish(it, TRC_WALK_NO_MEMORY);
      return false;
    }
    it->buffer = bigger;
    it->bufferSize = grown;
  }
  size_t rest = length - TRC_RECORD_HEADER_SIZE;
  if (rest != 0 && fread(it->buffer + TRC_RECORD_HEADER_SIZE, 1, rest, it->file) != rest)
    return ioFailure(it, "Error reading record %d.\n");
  it->filePos = pos + length;
  it->record = reinterpret_cast<const trcRecordHeader*>(it->buffer);
  return true;
}

bool readFromMemory(trcIter* it, uint32_t room) {
  const uint8_t* rec = reinterpret_cast<const uint8_t*>(it->header) + it->dataOffset + it->offset;
  uint32_t length;
  memcpy(&length, rec, sizeof length);
  if (length < TRC_RECORD_HEADER_SIZE || (length & 3) != 0 || length > room)
    return badRecord(it, length);
  it->record = reinterpret_cast<const trcRecordHeader*>(rec);
  return true;
}

bool start(trcIter* it) {
  it->started = true;
  const trcBlockHeader* h = it->header;
  if (const char* why = trcHeaderFault(h, it->fromFile ? 0 : it->imageSize)) {
    if (it->fromFile)
      fprintf(trcOut(), "Trace header of file \"%.*s\" is damaged (%s); no records are read.\n",
              static_cast<int>(sizeof h->fileName - 1), h->fileName, why);
    else
      fprintf(trcOut(), "Trace header of the shared buffer is damaged (%s); no records are read.\n",
              why);
    finish(it, TRC_WALK_BAD_HEADER);
    return false;
  }
  // The counters are read once: a live block may change under an unlocked
  // reader, and each check below must hold for the values used.
  it->dataOffset = h->dataOffset;
  it->writeOffset = h->writeOffset;
  it->oldestOffset = h->oldestOffset;
  it->highWater = h->highWaterOffset;
  it->entryCount = h->entryCount;
  if (it->fromFile && h->fileName[0] != '\0') {
    char path[TRC_KEY_SIZE];
    snprintf(path, sizeof path, "%.*s", static_cast<int>(sizeof h->fileName - 1), h->fileName);
    it->file = fopen(path, "rb");
    if (it->file == nullptr) {
      fprintf(trcOut(), "Unable to open file \"%s\".\n", path);
      finish(it, TRC_WALK_IO);
      return false;
    }
    it->buffer = static_cast<uint8_t*>(malloc(kFirstBufferSize));
    if (it->buffer == nullptr) {
      printf("Unable to get memory to read record %d.\n", 1);
      finish(it, TRC_WALK_NO_MEMORY);
      return false;
    }
    it->bufferSize = kFirstBufferSize;
    it->filePos = UINT64_MAX;
  } else if (it->fromFile) {
    finish(it, TRC_WALK_IO);
    return false;
  }
  if (it->entryCount == 0) {
    finish(it, TRC_WALK_OK);
    return false;
  }
  it->offset = it->oldestOffset;
  it->number = 1;
  return true;
}

}  // namespace

FILE* trcOut() { return g_trcAnchorStorage.out != nullptr ? g_trcAnchorStorage.out : stdout; }

const char* trcHeaderFault(const trcBlockHeader* h, size_t imageSize) {
  if (h->dataOffset < TRC_HEADER_SIZE) return "data-area offset below the header size";
  if ((h->dataOffset | h->writeOffset | h->oldestOffset | h->highWaterOffset) & 3)
    return "offsets not multiples of 4";
  if (h->writeOffset > h->highWaterOffset || h->oldestOffset > h->highWaterOffset)
    return "offsets beyond the high-water offset";
  if (imageSize != 0 && static_cast<uint64_t>(h->dataOffset) + h->highWaterOffset > imageSize)
    return "high-water offset beyond the end of the buffer";
  if (static_cast<uint64_t>(h->entryCount) * TRC_RECORD_HEADER_SIZE > bytesHeld(h))
    return "more entries than the data held";
  return nullptr;
}

void trcIterInit(trcIter* it, const trcBlockHeader* header, size_t imageSize, bool fromFile) {
  memset(it, 0, sizeof *it);
  it->header = header;
  it->imageSize = imageSize;
  it->fromFile = fromFile;
}

bool trcNextRecord(trcIter* it) {
  if (it->done) return false;
  if (!it->started) {
    if (!start(it)) return false;
  } else {
    if (static_cast<uint32_t>(it->number) >= it->entryCount) {
      finish(it, TRC_WALK_OK);
      return false;
    }
    it->offset += it->record->length;
    ++it->number;
  }
  // After a wrap the records run to the high-water offset and go on at 0.
  if (!it->wrapped && it->writeOffset <= it->oldestOffset && it->offset >= it->highWater) {
    it->offset = 0;
    it->wrapped = true;
  }
  if (it->offset >= stretchEnd(it)) {
    fprintf(trcOut(),
            "The trace header counts %u records but only %d are held; the rest of the trace "
            "is not read.\n",
            it->entryCount, it->number - 1);
    finish(it, TRC_WALK_SHORT);
    return false;
  }
  uint32_t room = stretchEnd(it) - it->offset;
  // Offsets are multiples of 4, so a length word always lies within room.
  return it->fromFile ? readFromFile(it, room) : readFromMemory(it, room);
}

void trcIterEnd(trcIter* it) {
  if (it->file != nullptr) fclose(it->file);
  it->file = nullptr;
  free(it->buffer);
  it->buffer = nullptr;
  it->bufferSize = 0;
  it->done = true;
}

bool trcNextObject(const trcRecordHeader* record, uint32_t* offset, int* index, trcObject* obj) {
  if (*index >= record->objectCount) return false;
  if (*index == 0) *offset = TRC_RECORD_HEADER_SIZE;
  const uint8_t* rec = reinterpret_cast<const uint8_t*>(record);
  uint32_t length = record->length;
  trcObjectHeader oh;
  if (*offset > length || length - *offset < TRC_OBJECT_HEADER_SIZE) {
    fprintf(trcOut(), "Object %d lies beyond the end of its record; it is not shown.\n",
            *index + 1);
    *index = record->objectCount;
    return false;
  }
  memcpy(&oh, rec + *offset, sizeof oh);
  if (oh.length > length - *offset - TRC_OBJECT_HEADER_SIZE) {
    fprintf(trcOut(),
            "Object %d of length %u runs past the end of its record; it is not shown.\n",
            *index + 1, static_cast<unsigned>(oh.length));
    *index = record->objectCount;
    return false;
  }
  obj->type = oh.type;
  obj->length = oh.length;
  obj->data = rec + *offset + TRC_OBJECT_HEADER_SIZE;
  obj->number = ++*index;
  *offset += TRC_OBJECT_HEADER_SIZE + ((oh.length + 3u) & ~3u);
  return true;
}

int trcReadFileHeader(const char* path, trcBlockHeader* header) {
  FILE* f = fopen(path, "rb");
  if (f == nullptr) return TRC_READ_NO_FILE;
  size_t got = fread(header, 1, TRC_HEADER_SIZE, f);
  fclose(f);
  return got == TRC_HEADER_SIZE ? TRC_READ_OK : TRC_READ_SHORT;
}
