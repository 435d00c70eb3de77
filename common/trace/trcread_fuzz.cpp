// Fuzz target: arbitrary bytes as a trace image. The first 20 bytes give the
// header's counters (data-area offset, write, oldest and high-water offsets,
// entry count), the rest is the data area. The image is walked in memory,
// written to a trace file, and the file walked again; every record and
// object handed out must lie inside what was read.
#include <unistd.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "common/trace/trcread.h"
#include "common/trace/trcwrite.h"

namespace {

constexpr size_t kCounters = 20;

uint32_t word(const uint8_t* p) {
  uint32_t v;
  memcpy(&v, p, sizeof v);
  return v;
}

// Small values are taken as offsets into the data area, so that most inputs
// get past the header checks; large ones stay as they are.
uint32_t offset(uint32_t raw, size_t dataLen) {
  return raw >= 0x80000000u ? raw : static_cast<uint32_t>(raw % (dataLen + 8));
}

void walkAll(const trcBlockHeader* h, size_t imageSize, bool fromFile, const uint8_t* lo,
             const uint8_t* hi) {
  trcIter it;
  trcIterInit(&it, h, imageSize, fromFile);
  uint32_t seen = 0;
  while (trcNextRecord(&it)) {
    const uint8_t* rec = reinterpret_cast<const uint8_t*>(it.record);
    uint32_t len = it.record->length;
    if (len < TRC_RECORD_HEADER_SIZE || len % 4 != 0) abort();
    if (!fromFile && (rec < lo || rec + len > hi)) abort();
    if (++seen > h->entryCount) abort();
    uint32_t off = 0;
    int index = 0;
    trcObject o;
    while (trcNextObject(it.record, &off, &index, &o))
      if (o.data < rec + TRC_RECORD_HEADER_SIZE || o.data + o.length > rec + len) abort();
  }
  if (it.file != nullptr || it.buffer != nullptr) abort();
}

std::string scratchPath() {
  char tmpl[] = "/tmp/trcread_fuzz.XXXXXX";
  int fd = mkstemp(tmpl);
  if (fd >= 0) close(fd);
  unlink(tmpl);
  return tmpl;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static const std::string path = scratchPath();
  static FILE* quiet = fopen("/dev/null", "w");
  g_trcAnchorStorage.out = quiet;
  if (size < kCounters) return 0;
  size_t dataLen = size - kCounters;
  std::vector<uint8_t> image(TRC_HEADER_SIZE + dataLen, 0);
  auto* h = reinterpret_cast<trcBlockHeader*>(image.data());
  uint32_t rawData = word(data);
  h->dataOffset = rawData >= 0x80000000u ? rawData : TRC_HEADER_SIZE;
  h->writeOffset = offset(word(data + 4), dataLen);
  h->oldestOffset = offset(word(data + 8), dataLen);
  h->highWaterOffset = offset(word(data + 12), dataLen);
  h->entryCount = word(data + 16) % 4096;
  h->bufferSize = static_cast<uint32_t>(image.size());
  h->maxFileSize = TRC_MAX_SIZE;
  strcpy(h->platform, TRC_PLATFORM);
  strcpy(h->structVersion, TRC_STRUCT_VERSION);
  strcpy(h->symbolVersion, TRC_SYMBOL_VERSION);
  memcpy(image.data() + TRC_HEADER_SIZE, data + kCounters, dataLen);
  const uint8_t* lo = image.data() + TRC_HEADER_SIZE;
  walkAll(h, image.size(), false, lo, lo + dataLen);

  snprintf(h->fileName, sizeof h->fileName, "%s", path.c_str());
  unlink(path.c_str());
  if (trcFlushToFile(h, false) == 0) {
    trcFlushToFile(h, false);  // and once appended
    trcBlockHeader fileHeader;
    if (trcReadFileHeader(path.c_str(), &fileHeader) == TRC_READ_OK)
      walkAll(&fileHeader, 0, true, nullptr, nullptr);
  }
  unlink(path.c_str());
  g_trcAnchorStorage.out = nullptr;
  return 0;
}
