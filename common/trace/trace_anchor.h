// The process's trace anchor and its attachment to a server's shared trace
// block. Until the trace block exists the anchor stays Initial and every
// trace point is a no-op.
#pragma once

#include <cstdint>

void trcInitAnchor();
// Attaches to the trace block "<keyPart1><keyPart2>.TRC" when one is on.
// 0 attached, 1000 no block, 1004 incompatible block.
int trcAttach(const char* keyPart1, const char* keyPart2, const void* appVersionBlock,
              const void* moduleList);
void trcDetach();
// Called on every pass of a server's command loop: lets go of a block whose
// trace was turned off.
void trcCheckStop();
