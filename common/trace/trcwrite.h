// The copy of a block image to its trace file, whole or lap by lap.
#pragma once

#include <cstdint>

#include "common/trace/trcblock.h"

// Answers of trcFlushToFile.
enum : int {
  TRC_FLUSH_DONE = 0,    // written, or nothing to write
  TRC_FLUSH_FAILED = 1,  // stopped on a failure
  TRC_FLUSH_FULL = 2,    // the file's data would exceed its maximum size: nothing written
};

// Writes a block image (a copy, or the live block) to the trace file named
// in it: appends to an existing file within its maximum size, or creates the
// file. report: print every failure (the first two always print).
int trcFlushToFile(const trcBlockHeader* image, bool report);

// Appends a lap of the live block (image: a copy of it, or the block itself)
// to its trace file; the caller holds the file lock. Once a lap did not fit
// the file's maximum size, nothing more is appended (a later, smaller lap
// would leave a gap in the file); the first refusal says so.
void trcFlushLap(trcBlockHeader* live, const trcBlockHeader* image);

// The last flush of a direct-to-file trace, as turning it off makes it:
// the block is copied under the buffer lock and the copy written under the
// file lock (without memory for a copy, the live block with both held).
void trcFlushLastLap(trcBlockHeader* block);

// A private copy of this process's attached block: bufferSize bytes, when
// that is within what is mapped. The caller holds the buffer lock. Null
// without memory or for a block whose size is impossible. free() it.
trcBlockHeader* trcCopyBlock(const trcBlockHeader* block);
