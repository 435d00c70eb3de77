// The arguments of the trace control command: keywords, options and their
// values as the parser leaves them, level lists, sizes, and the -df filters
// applied to a block's (or a formatting copy's) filter words.
#pragma once

#include <cstdint>

#include "common/trace/trcblock.h"

// One -df filter: a component or function name and its level mask.
struct trcFilter {
  const char* name;   // as typed (points into the argument vector)
  uint16_t mask;
};

struct trcOptions {
  // Subcommands and flags.
  bool on, off, kill, clr, resetlock, holdlock, dmp, flw, fmt, v7fmt, stat, statlong, statg,
      diag, listsymbols, hex, help, error;
  bool json;               // Chrome trace-event output
  uint16_t logLevel;       // -d: the block's global filter
  uint16_t outLevel;       // -d or -o: the formatting copy's global filter
  bool levelGiven;         // -d was given
  const char* dbName;      // -db / -subsystem, as typed (upper-cased when used)
  const char* kind;        // "CAP", "APP", "KCAP", "KAPP", "MON", or null
  const char* schema;      // -schema / -qualifier, as typed; default "KLP"
  const char* fileName;    // -fn, or the dump file after dmp
  const char* outFileName; // -ofn
  uint32_t bufferSize;     // -b
  uint32_t maxFileSize;    // -fs
  trcFilter* filters;      // -df, in command-line order
  int filterCount, filterCapacity;
};

// Fills o from the arguments (argv[0] is skipped), printing every complaint
// on the trace output stream; o->error tells whether the command may run.
// Free the filter list with trcFreeOptions.
void trcParseArgs(int argc, char** argv, trcOptions* o);

// The parser's keywords in table order, for the manual and the shell
// completion: the word as matched (null past the end) and how many values
// follow it (0, 1, or 2 for -df).
const char* trcKeyword(int i, int* values);
void trcFreeOptions(trcOptions* o);

// A level list: "1" to "6" add the bits 1, 2, 4, 8, 16, 32, commas are
// skipped, any other character ends the list.
uint16_t trcParseLevels(const char* text);
// A mask as the levels of its set level bits joined by commas ("1,2,4"), or
// "0"; out holds at least 12 characters.
void trcLevelText(uint16_t mask, char* out);
// A size: decimal digits and an optional K, M or G, in 32-bit arithmetic
// that wraps.
uint32_t trcParseSize(const char* text);

// Sets, for every filter in order, the override words of each component and
// each function row whose name equals it without regard to case.
void trcApplyFilters(trcBlockHeader* h, const trcFilter* filters, int count);
