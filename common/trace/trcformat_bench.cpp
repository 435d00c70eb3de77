// Formatting speed: fmt and flw of a large trace file (two threads, entry,
// data and exit records) written to /dev/null. Reports records per second;
// the target is at least 2 million for each style.
#include <benchmark/benchmark.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "common/trace/trace_anchor.h"
#include "common/trace/trcformat.h"

namespace {

constexpr int kRounds = 100000;  // 5 records each

void put(std::string* out, const void* p, size_t n) {
  out->append(static_cast<const char*>(p), n);
}

// One record: the 40-byte header and at most one object.
void record(std::string* out, uint8_t type, uint16_t fn, uint32_t tid, uint16_t level,
            uint32_t micro, uint16_t objType = 0, const std::string& obj = "") {
  uint32_t objLen = obj.empty() ? 0 : static_cast<uint32_t>(4 + ((obj.size() + 3) & ~size_t{3}));
  trcRecordHeader h;
  memset(&h, 0, sizeof h);
  h.length = 40 + objLen;
  h.levelMask = level;
  h.objectCount = obj.empty() ? 0 : 1;
  h.component = 23;
  h.function = fn;
  h.pid = 4711;
  h.threadId = tid;
  if (type == TRC_REC_DATA) {
    memcpy(h.name, "value          ", 16);
    h.name[15] = '\0';
  } else {
    h.time.seconds = 1700000000;
    h.time.microseconds = static_cast<int32_t>(micro % 1000000);
  }
  h.type = type;
  put(out, &h, sizeof h);
  if (obj.empty()) return;
  trcObjectHeader oh{objType, static_cast<uint16_t>(obj.size())};
  put(out, &oh, sizeof oh);
  std::string data = obj;
  data.resize((obj.size() + 3) & ~size_t{3}, '\0');
  out->append(data);
}

struct TraceFile {
  std::string path = "/tmp/trcformat_bench." + std::to_string(getpid());
  trcBlockHeader* header = static_cast<trcBlockHeader*>(calloc(1, sizeof(trcBlockHeader)));
  long records = 0;

  TraceFile() {
    std::string data;
    int16_t rc = 0;
    for (int i = 0; i < kRounds; ++i) {
      record(&data, TRC_REC_ENTRY, 2, 11, 1, i);
      record(&data, TRC_REC_DATA, 2, 11, 2, i, TRC_OBJ_STRING, "status " + std::to_string(i));
      record(&data, TRC_REC_EXIT_VALUE, 2, 11, 1, i, TRC_OBJ_RC, std::string(2, static_cast<char>(rc)));
      record(&data, TRC_REC_ENTRY, 3, 12, 1, i);
      record(&data, TRC_REC_EXIT, 3, 12, 1, i);
      records += 5;
    }
    trcBlockHeader* h = header;
    strcpy(h->platform, "Linux");
    strcpy(h->structVersion, "0012");
    strcpy(h->symbolVersion, "0024");
    h->componentCount = 54;
    h->functionsPerComponent = 250;
    for (int i = 0; i < 150; ++i) h->threadTable[i].key = h->threadOverflow[i].key = TRC_FREE_KEY;
    h->dataOffset = TRC_HEADER_SIZE;
    h->writeOffset = h->highWaterOffset = static_cast<uint32_t>(data.size());
    h->entryCount = static_cast<uint32_t>(records);
    h->globalFilter = 0x7FFF;
    snprintf(h->fileName, sizeof h->fileName, "%s", path.c_str());
    FILE* f = fopen(path.c_str(), "wb");
    fwrite(h, 1, sizeof *h, f);
    fwrite(data.data(), 1, data.size(), f);
    fclose(f);
    trcLoadThreadTables(h);
  }
  ~TraceFile() {
    unlink(path.c_str());
    free(header);
  }
};

TraceFile& traceFile() {
  static TraceFile file;
  return file;
}

template <typename F>
void formatToNull(benchmark::State& state, F style) {
  TraceFile& t = traceFile();
  FILE* sink = fopen("/dev/null", "w");
  trcImage image{t.header, sizeof(trcBlockHeader), true};
  for (auto _ : state) {
    flockfile(sink);
    style(sink, image);
    funlockfile(sink);
    fflush(sink);
  }
  fclose(sink);
  state.counters["records/s"] =
      benchmark::Counter(static_cast<double>(t.records) * static_cast<double>(state.iterations()),
                         benchmark::Counter::kIsRate);
}

void BM_FormatFullFromFile(benchmark::State& state) {
  formatToNull(state, [](FILE* out, const trcImage& im) { trcFormatFull(out, im, false); });
}
void BM_FormatFlowFromFile(benchmark::State& state) {
  formatToNull(state, [](FILE* out, const trcImage& im) { trcFormatFlow(out, im); });
}

}  // namespace

BENCHMARK(BM_FormatFullFromFile)->Unit(benchmark::kMillisecond)->UseRealTime();
BENCHMARK(BM_FormatFlowFromFile)->Unit(benchmark::kMillisecond)->UseRealTime();
