// Formatting a trace: obtaining the image to format (a copy of the shared
// block, the live block under its lock, or a trace file's header), the
// format filters, the header with version information and thread data, and
// the three styles: flw (a call tree per thread), fmt (every record with its
// objects) and v7fmt (data lines indented by call depth).
#pragma once

#include <cstddef>
#include <cstdio>

#include "common/trace/trcblock.h"
#include "common/trace/trcopts.h"

// The version information of a block or file header: the trace's and the
// application's release information, the database version and the attach
// time (the head of every formatted trace and of the status report).
void trcPrintVersionInfo(FILE* out, const trcBlockHeader* h);

// What is formatted: an image of imageSize bytes (a copy or the live block),
// or with fromFile a file header whose file name says where the records are.
struct trcImage {
  trcBlockHeader* header;
  size_t size;
  bool fromFile;
};

void trcFormatFlow(FILE* out, const trcImage& image);
void trcFormatFull(FILE* out, const trcImage& image, bool hex);
void trcFormatV7(FILE* out, const trcImage& image);

// Header (version information and thread data), then each style asked for.
void trcFormatStyles(FILE* out, const trcImage& image, bool flw, bool fmt, bool v7fmt, bool hex);

// The image to format for a command, obtained under the block's locks as
// the options say, with the format filters set; give it back with
// trcReleaseImage, which restores the live block's filters and locks.
struct trcSource {
  trcImage image;
  trcBlockHeader* live;      // the attached block, or null
  bool holding;              // the live block is formatted under its buffer lock
  bool fileLocked;           // the live block's file lock is held
  uint8_t* savedFilters;     // the live block's filters while holding
  bool owned;                // image.header was allocated here
};
// False when there is nothing to format (the reason was printed).
bool trcObtainImage(const trcOptions* o, trcSource* src);
void trcReleaseImage(trcSource* src);

// The formatting step of the trace command: obtain, format the styles asked
// for (or the trace-event JSON), release.
void trcFormatCommand(const trcOptions* o);
