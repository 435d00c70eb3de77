// One put and one get of a command-sized message on a POSIX queue, the unit
// of every command exchange.
#include <benchmark/benchmark.h>

#include <unistd.h>

#include <string>

#include "common/platform/hsv.h"

namespace {

void BM_QueuePutGet(benchmark::State& state) {
  std::string path = "/tmp/klpbench.queue." + std::to_string(getpid());
  HSVResID id;
  hsvIPCGetQueResID(path.c_str(), HSV_QUEUE_RESID_OPTION, &id);
  HSVHIPCQueue q;
  if (q.create(id, HSV_MAX_MSG_SIZE, HSV_CREATE_OPTION) != ECF_OK) {
    state.SkipWithError("queue not created");
    return;
  }
  std::string msg(static_cast<size_t>(state.range(0)), 'x');
  char buf[HSV_MAX_MSG_SIZE];
  size_t got = 0;
  for (auto _ : state) {
    q.put(msg.data(), msg.size());
    q.get(buf, sizeof buf, &got, 1000);
  }
  q.destroy();
}
BENCHMARK(BM_QueuePutGet)->Arg(44)->Arg(4096);

}  // namespace
