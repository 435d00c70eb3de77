// Reading trace records: from a block image in memory (the live block or a
// copy of it) or from a trace file. Everything read was written by another
// process or comes from a file, so every length and offset is checked before
// it is used; a damaged trace ends the walk with a message on the anchor's
// output stream, never with a read outside the image.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstdio>

#include "common/trace/trcblock.h"

// Why a walk ended (trcIter::error).
enum : int {
  TRC_WALK_OK = 0,          // every record the header counts was read
  TRC_WALK_BAD_HEADER,      // data-area offset or counters impossible
  TRC_WALK_BAD_RECORD,      // a record length below 40, not a multiple of 4, or too long
  TRC_WALK_SHORT,           // fewer records held than the entry count says
  TRC_WALK_IO,              // the file could not be positioned or read
  TRC_WALK_NO_MEMORY,       // no memory for the record buffer
};

// Record iterator. Set it up with trcIterInit, then call trcNextRecord until
// it answers false; the fields below the line are its own.
struct trcIter {
  const trcBlockHeader* header;   // the image, or a file header read into memory
  size_t imageSize;               // bytes readable from header on (memory images)
  bool fromFile;                  // records come from the file named in the header
  const trcRecordHeader* record;  // the current record, valid until the next call
  uint32_t offset;                // its offset in the data area
  int32_t number;                 // its number, from 1
  int error;                      // TRC_WALK_*, once the walk is over
  // ---
  bool started, done, wrapped;
  uint32_t dataOffset, writeOffset, oldestOffset, highWater, entryCount;
  FILE* file;
  uint64_t filePos;      // where the file stands after the last read; no seek needed there
  uint64_t fileSize;     // the file's size when last looked at
  uint8_t* buffer;
  size_t bufferSize;
};

// A walk over the records of an image of imageSize bytes (the block's mapping
// or a copy), or, with fromFile, over the file named in header->fileName
// (header then holds that file's header; imageSize is unused).
void trcIterInit(trcIter* it, const trcBlockHeader* header, size_t imageSize, bool fromFile);

// Steps to the next record, oldest first: true with it->record set; false
// when the walk is over (it->error tells whether it was cut short; the reason
// has been printed). Closes the file and frees the buffer when it ends.
bool trcNextRecord(trcIter* it);

// Ends a walk before trcNextRecord did: closes the file, frees the buffer.
void trcIterEnd(trcIter* it);

// One object of a record.
struct trcObject {
  uint16_t type;
  uint16_t length;        // data bytes
  const uint8_t* data;    // inside the record
  int number;             // from 1
};

// Steps through the objects of a record whose length trcNextRecord checked.
// Start with *offset = 0 and *index = 0. True with *obj set; false when all
// objectCount objects were taken, or when the next one would run past the
// record (reported: the rest of the record is not shown).
bool trcNextObject(const trcRecordHeader* record, uint32_t* offset, int* index, trcObject* obj);

// Why a header cannot be walked, or null when its data-area offset and
// counters are possible: for memory images within imageSize bytes; for files
// (imageSize 0) only among themselves, since the file may be read as it
// grows.
const char* trcHeaderFault(const trcBlockHeader* header, size_t imageSize);

// Reading a trace file's header.
enum : int {
  TRC_READ_OK = 0,
  TRC_READ_NO_FILE = 1,      // it could not be opened for reading
  TRC_READ_SHORT = 2,        // it holds less than a whole header
};
// Reads the first TRC_HEADER_SIZE bytes of path into *header.
int trcReadFileHeader(const char* path, trcBlockHeader* header);

// The stream for trace messages: the anchor's output stream, or stdout.
FILE* trcOut();
