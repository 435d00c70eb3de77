// Shared by the trace module's own sources: who may use the attached block.
// A trace point may run on any thread while another thread lets go of the
// block, so writers announce themselves and the one letting go unmaps only
// once none is left inside.
#pragma once

#include <cstddef>

#include "common/trace/trcblock.h"

namespace trcint {

// The attached block with the caller counted as a writer, or null (not
// counted) when none is attached or the anchor is not Running.
trcBlockHeader* enterBlock();
// Leaves a block entered with enterBlock.
void leaveBlock();
// Publishes (or, with null, withdraws) the anchor's block and its mapped
// size; withdrawing waits until no writer is inside any more.
void publishBlock(trcBlockHeader* block, size_t mappedSize);
// Bytes mapped of the published block; valid while the caller is inside.
size_t mappedSize();
// The calling thread's id as records carry it.
uint32_t threadId();

}  // namespace trcint
