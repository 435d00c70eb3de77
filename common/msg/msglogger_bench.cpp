// Cost of issuing one message: record, header values, built-in text lookup,
// substitution and routing, with and without the log-file line.
#include <benchmark/benchmark.h>

#include <cstdio>
#include <cstdlib>
#include <string>

#include "common/msg/msglogger.h"

namespace {

struct Logger {
  msgLogger* log = createMsgLoggerU(MSG_APP_KLPKCCMD, 0);
  Logger() {
    log->loadBuiltinMsgs(builtinMsgTable);
    log->setProgramQualifier("KLP");
  }
  ~Logger() { delete log; }
};

void BM_ComposeOnly(benchmark::State& state) {
  Logger l;
  char text[1025];
  for (auto _ : state) {
    l.log->getKlpMsgText(8006, "bench", "T", text, sizeof text, "value");
    benchmark::DoNotOptimize(text);
  }
}
BENCHMARK(BM_ComposeOnly);

void BM_IssueToLogFile(benchmark::State& state) {
  Logger l;
  char dir[] = "/tmp/klpbench.XXXXXX";
  if (!mkdtemp(dir)) {
    state.SkipWithError("mkdtemp failed");
    return;
  }
  l.log->setLogFileName(dir, "bench.log");
  for (auto _ : state) l.log->putKlpMsg(8006, MSG_DEST_LOGFILE, "bench", "T", "value");
  std::remove((std::string(dir) + "/bench.log").c_str());
  std::remove(dir);
}
BENCHMARK(BM_IssueToLogFile);

}  // namespace
