// cpcvc converting 1 KiB values from CCSID 37 to 1208, side by side with
// ICU's direct ucnv_convertEx and glibc's iconv on the same bytes, then the
// throughput ratios of cpcvc against both.
#include <benchmark/benchmark.h>
#include <iconv.h>
#include <unicode/ucnv.h>

#include <cstdio>
#include <cstring>
#include <map>
#include <string>
#include <vector>

#include "common/conv/convmgr.h"

namespace {

constexpr size_t kValueBytes = 1024;

// 1 KiB of EBCDIC 37 text with a few accented letters.
const std::vector<char>& ebcdicValue() {
  static std::vector<char> value = [] {
    std::string text;
    while (text.size() < kValueBytes) text += "Zoë's café order #42: crème brûlée, 3 × ½ kg. ";
    UErrorCode err = U_ZERO_ERROR;
    std::vector<char> out(kValueBytes * 2);
    int32_t n = ucnv_convert("cp037", "UTF-8", out.data(), static_cast<int32_t>(out.size()),
                             text.data(), static_cast<int32_t>(text.size()), &err);
    out.resize(static_cast<size_t>(n));
    out.resize(kValueBytes);
    return out;
  }();
  return value;
}

void BM_Cpcvc(benchmark::State& state) {
  const std::vector<char>& in = ebcdicValue();
  static ConvMgr mgr(4);
  char out[4 * kValueBytes];
  for (auto _ : state) {
    char* t = out;
    int16_t len = sizeof out;
    if (mgr.cpcvc(37, in.data(), 1208, &len, &t, kValueBytes, 0, 0, 0) != 0)
      state.SkipWithError("cpcvc failed");
    benchmark::DoNotOptimize(out);
  }
  state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * kValueBytes));
}

void BM_IcuConvertEx(benchmark::State& state) {
  const std::vector<char>& in = ebcdicValue();
  UErrorCode err = U_ZERO_ERROR;
  UConverter* src = ucnv_openCCSID(37, kCcsidPlatform, &err);
  UConverter* tgt = ucnv_open("UTF-8", &err);
  UChar pivot[1024];
  char out[4 * kValueBytes];
  for (auto _ : state) {
    char* t = out;
    const char* s = in.data();
    UChar* ps = pivot;
    UChar* pt = pivot;
    err = U_ZERO_ERROR;
    ucnv_convertEx(tgt, src, &t, out + sizeof out, &s, s + kValueBytes, pivot, &ps, &pt,
                   pivot + 1024, true, true, &err);
    benchmark::DoNotOptimize(out);
  }
  ucnv_close(src);
  ucnv_close(tgt);
  state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * kValueBytes));
}

void BM_Iconv(benchmark::State& state) {
  const std::vector<char>& in = ebcdicValue();
  iconv_t cd = iconv_open("UTF-8", "CP037");
  if (cd == reinterpret_cast<iconv_t>(-1)) {
    state.SkipWithError("iconv has no CP037");
    return;
  }
  char out[4 * kValueBytes];
  for (auto _ : state) {
    char* s = const_cast<char*>(in.data());
    size_t left = kValueBytes;
    char* t = out;
    size_t room = sizeof out;
    iconv(cd, nullptr, nullptr, nullptr, nullptr);
    iconv(cd, &s, &left, &t, &room);
    benchmark::DoNotOptimize(out);
  }
  iconv_close(cd);
  state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * kValueBytes));
}

BENCHMARK(BM_Cpcvc);
BENCHMARK(BM_IcuConvertEx);
BENCHMARK(BM_Iconv);

// Keeps each run's bytes per second for the ratios.
class RatioReporter : public benchmark::ConsoleReporter {
 public:
  std::map<std::string, double> rate;
  void ReportRuns(const std::vector<Run>& runs) override {
    for (const Run& r : runs) {
      auto it = r.counters.find("bytes_per_second");
      if (it != r.counters.end()) rate[r.benchmark_name()] = it->second;
    }
    ConsoleReporter::ReportRuns(runs);
  }
};

}  // namespace

int main(int argc, char** argv) {
  benchmark::Initialize(&argc, argv);
  RatioReporter reporter;
  benchmark::RunSpecifiedBenchmarks(&reporter);
  double cpcvc = reporter.rate["BM_Cpcvc"], icu = reporter.rate["BM_IcuConvertEx"],
         iconvRate = reporter.rate["BM_Iconv"];
  if (cpcvc > 0 && icu > 0 && iconvRate > 0) {
    printf("cpcvc 37->1208 on 1 KiB values: %.0f MB/s; ICU ucnv_convertEx %.0f MB/s; glibc iconv "
           "%.0f MB/s\n", cpcvc / 1e6, icu / 1e6, iconvRate / 1e6);
    printf("ratio cpcvc/ICU   = %.2f (target >= 0.80)\n", cpcvc / icu);
    printf("ratio cpcvc/iconv = %.2f (target >= 1.15)\n", cpcvc / iconvRate);
  }
  benchmark::Shutdown();
  return 0;
}
