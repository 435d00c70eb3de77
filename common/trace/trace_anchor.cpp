#include "common/trace/trace_anchor.h"

#include "common/trace/trace.h"

// Trace blocks are not created by anything yet, so there is never a block to
// attach to: the anchor stays Initial and the trace points stay silent.
void trcInitAnchor() {}

int trcAttach(const char*, const char*, const void*, const void*) { return 1000; }

void trcDetach() {}

void trcCheckStop() {}
