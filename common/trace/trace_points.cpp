// Trace points. Until a trace anchor is Running they do nothing.
#include "common/trace/trace.h"

#include <atomic>

namespace {
std::atomic<uint32_t> g_anchorState{TRC_STATE_INITIAL};
}

uint32_t trcAnchorState() { return g_anchorState.load(std::memory_order_relaxed); }

uint32_t trcLevel(int, int) {
  if (!trcIsRunning()) return 0;
  return 0;
}

uint32_t trcEntry(int component, int function) { return trcLevel(component, function); }

void trcExit(int, int, int, int16_t, int32_t, int64_t) {}

uint32_t trcDataN(int component, int function, const char*, uint32_t, int, const int*,
                  const uint32_t*, const void* const*) {
  return trcLevel(component, function);
}
