#include "common/trace/trace_anchor.h"

// Trace blocks are not created by anything yet, so there is never a block to
// attach to: the anchor stays Initial and the trace points stay silent.
void trcInitAnchor() {}

int trcAttach(const char*, const char*, const klpAppVersion*, const klpModuleList*) {
  return TRC_RC_NO_ADDRESS;
}

void trcDetach() {}

void trcCheckStop() {}
