// Trace points. Until a trace anchor is Running they do nothing.
#include "common/trace/trace.h"

trcAnchor g_trcAnchorStorage;

uint32_t trcLevelBody(int, int) { return 0; }

uint32_t trcEntryBody(int, int) { return 0; }

void trcExitBody(int, int, int, int16_t, int32_t, int64_t) {}

uint32_t trcDataN(int, int, const char*, uint32_t, int, const int*, const uint32_t*,
                  const void* const*) {
  return 0;
}
