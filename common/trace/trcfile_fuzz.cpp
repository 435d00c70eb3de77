// Fuzz target: a trace as the formatter reads it, from memory and from a
// file. The input's first 24 bytes give the header's data-area offset (above
// the header by a multiple of 4 up to 1020), write, oldest and high-water
// offsets, entry count and global filter; the rest is the data area. Every
// style and the trace-event JSON run over it.
#include <unistd.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "common/trace/trace.h"
#include "common/trace/trcformat.h"
#include "common/trace/trcjson.h"

namespace {

uint32_t word(const uint8_t* p) {
  uint32_t v;
  memcpy(&v, p, sizeof v);
  return v;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static FILE* sink = fopen("/dev/null", "w");
  static std::string path = "/tmp/trcfile_fuzz." + std::to_string(getpid());
  if (size < 24 || sink == nullptr) return 0;
  g_trcAnchorStorage.out = sink;  // the reader's complaints
  uint32_t extra = (word(data) & 0xFF) * 4;
  size_t imageSize = TRC_HEADER_SIZE + extra + (size - 24);
  trcBlockHeader* h = static_cast<trcBlockHeader*>(calloc(1, imageSize));
  strcpy(h->platform, "Linux");
  strcpy(h->structVersion, "0012");
  strcpy(h->symbolVersion, "0024");
  h->componentCount = 54;
  h->functionsPerComponent = 250;
  for (int i = 0; i < 150; ++i) h->threadTable[i].key = h->threadOverflow[i].key = 0xFFFFFFFF;
  h->threadTable[7].key = h->threadTable[7].threadId = 7;
  memset(h->threadTable[7].threadName, 'N', sizeof h->threadTable[7].threadName);
  h->dataOffset = TRC_HEADER_SIZE + extra;
  h->writeOffset = word(data + 4);
  h->oldestOffset = word(data + 8);
  h->highWaterOffset = word(data + 12);
  h->entryCount = word(data + 16);
  memcpy(&h->globalFilter, data + 20, sizeof h->globalFilter);
  h->componentFilters[11] = static_cast<uint16_t>(0x8000 | data[22]);
  h->functionFilters[23][2] = static_cast<uint16_t>(0x8000 | data[23]);
  memcpy(reinterpret_cast<uint8_t*>(h) + h->dataOffset, data + 24, size - 24);

  trcImage memory{h, imageSize, false};
  trcFormatStyles(sink, memory, true, true, true, data[23] & 1);
  trcFormatJson(sink, memory);

  if (FILE* f = fopen(path.c_str(), "wb")) {
    fwrite(h, 1, imageSize, f);
    fclose(f);
    snprintf(h->fileName, sizeof h->fileName, "%s", path.c_str());
    trcImage file{h, TRC_HEADER_SIZE, true};
    trcFormatStyles(sink, file, true, true, true, false);
    trcFormatJson(sink, file);
    unlink(path.c_str());
  }
  g_trcAnchorStorage.out = nullptr;
  free(h);
  return 0;
}
