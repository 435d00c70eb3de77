// The writer under the trace points, and the copy of a block image to its
// trace file.
#pragma once

#include <cstdint>

#include "common/trace/trcblock.h"

// Appends one record to the attached block: wraps the data area when the
// record does not fit at the write offset (dropping the oldest records it
// overwrites; in direct-to-file mode the area written since the last wrap is
// first appended to the trace file). timeOrName is the record's 16-byte time
// value or data name. A record longer than the data area is not written.
void trcWriteRecord(int component, int function, uint16_t levelMask, const void* timeOrName,
                    uint8_t recordType, uint32_t recordLength, int objectCount,
                    const int* types, const uint32_t* lengths, const void* const* pointers);

// Writes a block image (a copy, or the live block) to the trace file named
// in it: appends to an existing file within its maximum size, or creates the
// file. report: print every failure (the first two always print).
// 0 written (or nothing to write); nonzero when it stopped on a failure.
int trcFlushToFile(const trcBlockHeader* image, bool report);

// A private copy of this process's attached block: bufferSize bytes, when
// that is within what is mapped. The caller holds the buffer lock. Null
// without memory or for a block whose size is impossible. free() it.
trcBlockHeader* trcCopyBlock(const trcBlockHeader* block);
