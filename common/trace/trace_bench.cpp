// Cost of trace points: a point while tracing is off (one load of the
// anchor's state and a branch), and a data point with one integer object
// written into a live block, from one thread and from two contending for
// the buffer lock.
#include <benchmark/benchmark.h>

#include <unistd.h>

#include <cstdlib>
#include <string>

#include "common/trace/trace.h"
#include "common/trace/trace_anchor.h"
#include "common/trace/trc_internal.h"

namespace {

void BM_DisabledTracePoint(benchmark::State& state) {
  trcInitAnchor();
  int v = 1;
  for (auto _ : state) {
    benchmark::DoNotOptimize(trcData(5, 7, "value", 2, 1, 4, &v));
  }
}
BENCHMARK(BM_DisabledTracePoint);

// One live block for the process; removed at exit.
void startTrace() {
  static bool started = [] {
    static std::string key = "BENCH" + std::to_string(getpid()) + ".KLP.KCAP";
    trcInitAnchor();
    if (trcCreate(2097152, "/tmp/", key.c_str(), nullptr, 2147483647, 0x3F, true) != 0)
      return false;
    atexit(trcFree);
    return true;
  }();
  (void)started;
}

void BM_EnabledDataOneInt(benchmark::State& state) {
  if (state.thread_index() == 0) startTrace();
  int v = state.thread_index();
  for (auto _ : state) {
    if (trcData(5, 7, "value", 2, 1, 4, &v) == 0) {
      state.SkipWithError("trace not running");
      break;
    }
    ++v;
  }
  state.SetItemsProcessed(state.iterations());
  state.SetLabel(trcint::g_asymmetric ? "writers ordered by process-wide barrier"
                                      : "writers ordered by fence");
}
BENCHMARK(BM_EnabledDataOneInt)->Threads(1)->Threads(2)->UseRealTime();

}  // namespace
