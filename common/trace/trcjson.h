// A trace as Chrome trace-event JSON, which Perfetto and chrome://tracing
// open: function entries and exits become B/E events of their process and
// thread, data records instant events carrying their formatted objects as
// arguments, and every thread is named by a metadata event.
#pragma once

#include <cstdio>

#include "common/trace/trcformat.h"

void trcFormatJson(FILE* out, const trcImage& image);
