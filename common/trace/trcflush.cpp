// trcFlushToFile: a block image to its trace file. An existing file is
// appended to (its header refreshed, its counters advanced); a missing one
// is created with a header of its own followed by the image's records,
// oldest first.
#include <sys/types.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "common/trace/trace_anchor.h"
#include "common/trace/trcread.h"
#include "common/trace/trcwrite.h"

namespace {

struct Flush {
  const trcBlockHeader* image;
  const char* path;
  bool report;
  FILE* out;
  trcBlockHeader* header;  // the file's header being built or refreshed
  FILE* file;
};

void say(const Flush& f, const char* fmt, const char* arg) {
  if (f.report) fprintf(f.out, fmt, arg);
}

void sayErrno(const Flush& f, const char* fmt, int err) {
  if (f.report) fprintf(f.out, fmt, f.path, err, strerror(err));
}

bool seekTo(FILE* file, uint64_t pos) { return fseeko(file, static_cast<off_t>(pos), SEEK_SET) == 0; }

bool writeAll(FILE* file, const void* p, size_t n) { return n == 0 || fwrite(p, 1, n, file) == n; }

// Records found stepping from the data-area start up to the write offset of
// an image; a damaged length stops the count there.
uint32_t countRecords(const trcBlockHeader* image) {
  const uint8_t* data = reinterpret_cast<const uint8_t*>(image) + image->dataOffset;
  uint32_t count = 0;
  for (uint32_t off = 0; off < image->writeOffset;) {
    uint32_t len;
    if (image->writeOffset - off < TRC_RECORD_HEADER_SIZE) break;
    memcpy(&len, data + off, sizeof len);
    if (len < TRC_RECORD_HEADER_SIZE || (len & 3) != 0 || len > image->writeOffset - off) break;
    off += len;
    ++count;
  }
  return count;
}

// The version part and both thread tables come from the image.
void refreshFromImage(trcBlockHeader* h, const trcBlockHeader* image) {
  memcpy(h, image, TRC_VERSION_PART_SIZE);
  memcpy(h->threadTable, image->threadTable, sizeof h->threadTable);
  memcpy(h->threadOverflow, image->threadOverflow, sizeof h->threadOverflow);
}

// appendToFile: the header could not be read whole; the file is made afresh.
constexpr int kRecreate = -1;

// Appends to an existing file: TRC_FLUSH_* or kRecreate.
int appendToFile(Flush& f) {
  const trcBlockHeader* img = f.image;
  if (img->entryCount == 0) {
    say(f, "Trace buffer is empty, no action taken.\n", nullptr);
    return TRC_FLUSH_DONE;
  }
  f.file = fopen(f.path, "r+b");
  if (f.file == nullptr) {
    say(f, "Unable to update file \"%s\"\n", f.path);
    return TRC_FLUSH_FAILED;
  }
  if (!seekTo(f.file, 0)) {
    sayErrno(f,
             "Unable to set file position to start of existing file \"%s\" to read trace "
             "control block,\nfseek() error:  \"%d\", reason:  \"%s\".\n",
             errno);
    return TRC_FLUSH_FAILED;
  }
  if (fread(f.header, 1, TRC_HEADER_SIZE, f.file) != TRC_HEADER_SIZE) return kRecreate;
  trcBlockHeader* h = f.header;
  if (!trcCheckVersion(h, f.path, f.report)) return TRC_FLUSH_FAILED;
  if (const char* why = trcHeaderFault(h, 0)) {
    if (f.report)
      fprintf(f.out, "Header of file \"%s\" is damaged (%s), no data appended.\n", f.path, why);
    return TRC_FLUSH_FAILED;
  }
  bool limited = strncmp(f.path, "//'", 3) != 0;
  if (limited && static_cast<uint64_t>(img->writeOffset) + h->writeOffset > img->maxFileSize)
    return TRC_FLUSH_FULL;
  refreshFromImage(h, img);
  if (!seekTo(f.file, static_cast<uint64_t>(h->dataOffset) + h->writeOffset)) {
    sayErrno(f,
             "Unable to set file position in file \"%s\" to write next data record,\nfseek() "
             "error:  \"%d\", reason:  \"%s\".\n",
             errno);
    return TRC_FLUSH_FAILED;
  }
  const uint8_t* data = reinterpret_cast<const uint8_t*>(img) + img->dataOffset;
  if (!writeAll(f.file, data, img->writeOffset)) {
    say(f, "Error writing data to file \"%s\"\n", f.path);
    return TRC_FLUSH_FAILED;
  }
  h->writeOffset += img->writeOffset;
  h->highWaterOffset = h->writeOffset;
  h->entryCount += img->writeOffset > img->oldestOffset ? img->entryCount : countRecords(img);
  if (!seekTo(f.file, 0)) {
    sayErrno(f,
             "Unable to set file position to start of existing file \"%s\" to update trace "
             "control block,\nfseek() error:  \"%d\", reason:  \"%s\".\n",
             errno);
    return TRC_FLUSH_FAILED;
  }
  if (!writeAll(f.file, h, TRC_HEADER_SIZE)) {
    say(f, "Error updating header for file \"%s\"\n", f.path);
    return TRC_FLUSH_FAILED;
  }
  return TRC_FLUSH_DONE;
}

// Writes the records of the image, oldest first; answers the bytes written
// or -1.
int64_t writeRecords(Flush& f) {
  const trcBlockHeader* img = f.image;
  const uint8_t* data = reinterpret_cast<const uint8_t*>(img) + img->dataOffset;
  // Before a wrap the records end at the write offset; bytes up to the
  // high-water offset beyond it are stale and stay out of the file.
  bool wrapped = img->writeOffset <= img->oldestOffset;
  uint32_t end = wrapped ? img->highWaterOffset : img->writeOffset;
  int64_t written = end - img->oldestOffset;
  if (!writeAll(f.file, data + img->oldestOffset, end - img->oldestOffset)) return -1;
  if (wrapped) {
    if (!writeAll(f.file, data, img->writeOffset)) return -1;
    written += img->writeOffset;
  }
  return written;
}

int createFile(Flush& f) {
  const trcBlockHeader* img = f.image;
  f.file = fopen(f.path, "wb");
  if (f.file == nullptr) {
    say(f, "Unable to create file \"%s\"\n", f.path);
    return TRC_FLUSH_FAILED;
  }
  trcBlockHeader* h = f.header;
  memset(h, 0, TRC_HEADER_SIZE);
  refreshFromImage(h, img);
  h->dataOffset = img->dataOffset;
  h->entryCount = img->entryCount;
  snprintf(h->fileName, sizeof h->fileName, "%s", f.path);
  if (img->entryCount != 0) {
    if (!seekTo(f.file, img->dataOffset)) {
      sayErrno(f,
               "Unable to set file position in file \"%s\" to start of data buffer to write "
               "next data record,\nfseek() error:  \"%d\", reason:  \"%s\".\n",
               errno);
      return TRC_FLUSH_FAILED;
    }
    int64_t written = writeRecords(f);
    if (written < 0) {
      say(f, "Error writing data to file \"%s\"\n", f.path);
      return TRC_FLUSH_FAILED;
    }
    h->writeOffset = h->highWaterOffset = static_cast<uint32_t>(written);
  }
  if (!seekTo(f.file, 0)) {
    sayErrno(f,
             "Unable to set file position to start of new file \"%s\" to update trace control "
             "block,\nfseek() error:  \"%d\", reason:  \"%s\".\n",
             errno);
    return TRC_FLUSH_FAILED;
  }
  if (!writeAll(f.file, h, TRC_HEADER_SIZE)) {
    say(f, "Error writing header for file \"%s\"\n", f.path);
    return TRC_FLUSH_FAILED;
  }
  if (img->dataOffset > TRC_HEADER_SIZE &&
      !writeAll(f.file, reinterpret_cast<const uint8_t*>(img) + TRC_HEADER_SIZE,
                img->dataOffset - TRC_HEADER_SIZE)) {
    say(f, "Error writing service info for file \"%s\"\n", f.path);
    return TRC_FLUSH_FAILED;
  }
  return TRC_FLUSH_DONE;
}

bool fileExists(const char* path) {
  FILE* probe = fopen(path, "rb");
  if (probe == nullptr) return false;
  fclose(probe);
  return true;
}

}  // namespace

int trcFlushToFile(const trcBlockHeader* image, bool report) {
  FILE* out = trcOut();
  if (image == nullptr) {
    fputs("Trace buffer not specified, no action taken.\n", out);
    return TRC_FLUSH_FAILED;
  }
  char path[TRC_KEY_SIZE];
  snprintf(path, sizeof path, "%.*s", static_cast<int>(sizeof image->fileName - 1),
           image->fileName);
  // The image holds bufferSize bytes; its counters must lie within them.
  if (const char* why = trcHeaderFault(image, image->bufferSize)) {
    if (report) fprintf(out, "Trace buffer is damaged (%s), no data written to \"%s\".\n", why, path);
    return TRC_FLUSH_FAILED;
  }
  Flush f{image, path, report, out, nullptr, nullptr};
  f.header = static_cast<trcBlockHeader*>(malloc(TRC_HEADER_SIZE));
  if (f.header == nullptr) {
    fprintf(out,
            "Unable to allocate storage for local copy of trace control block for file "
            "\"%s\".\n",
            path);
    return TRC_FLUSH_FAILED;
  }
  int rc = kRecreate;
  if (fileExists(path)) {
    rc = appendToFile(f);
    if (f.file != nullptr) fclose(f.file);
    f.file = nullptr;
  }
  if (rc == kRecreate) {
    rc = createFile(f);
    if (f.file != nullptr && fclose(f.file) != 0 && rc == 0) {
      say(f, "Error writing header for file \"%s\"\n", path);
      rc = TRC_FLUSH_FAILED;
    }
    if (rc != 0 && f.file != nullptr) remove(path);
  }
  free(f.header);
  return rc;
}

void trcFlushLap(trcBlockHeader* live, const trcBlockHeader* image) {
  if (live->fileFull) return;
  if (trcFlushToFile(image, false) != TRC_FLUSH_FULL) return;
  live->fileFull = 1;
  fprintf(trcOut(),
          "Trace file \"%.*s\" has reached its maximum size of %u bytes, no more records are "
          "written to it.\n",
          static_cast<int>(sizeof live->fileName - 1), live->fileName, live->maxFileSize);
}
