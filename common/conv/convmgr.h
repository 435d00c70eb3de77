// Code-page conversion between CCSIDs over ICU, with UTF-16 as the pivot.
//
// The ICU converters are opened once per process (one master converter per
// CCSID, under a recursive lock) and every manager works on its own clones of
// them, so managers of different threads convert in parallel. A manager
// belongs to one thread. Output a manager allocates for its caller lives in
// the manager's output arena until releaseOutputs() or destruction; the UTF-16
// intermediate text of one conversion lives in a second arena that is reset
// after every conversion.
#pragma once

#include <unicode/ucnv.h>

#include <cstddef>
#include <cstdint>

// ICU's platform of CCSID numbers (platform 0): tables are opened by number.
constexpr UConverterPlatform kCcsidPlatform = static_cast<UConverterPlatform>(0);

struct UConverter;

enum : int {
  CONV_RC_DBCS_ONLY = 823,   // getCcsidInfo: a pure double-byte CCSID
  CONV_RC_NO_STATE = 1000,   // process state ended (cleanup) or no clone
  CONV_RC_ICU = 5000,        // ICU could not open, clone or name a converter
  CONV_RC_CONVERT = 5001,    // the data could not be converted
  CONV_RC_TOO_SMALL = 5003,  // the output does not fit
  CONV_RC_RUNBUF = 6024,     // the running buffer is too small
};

constexpr uint8_t CONV_SHIFT_OUT = 0x0E;
constexpr uint8_t CONV_SHIFT_IN = 0x0F;

// 1200, 1202, 13488, 13490 and 17586: no converter on that side.
bool convIsUtf16(uint32_t ccsid);

// One converter of a list: its CCSID and ICU handle (null while free).
struct ConvListItem {
  uint32_t ccsid;
  UConverter* conv;
  ConvListItem* next;
};

// A chain of blocks handed out from front to back; each block is a 24-byte
// header followed by its data.
struct ConvArenaBlock;
struct ConvArena {
  ConvArenaBlock* first;
  ConvArenaBlock* current;
  int32_t stdCapacity;  // 32713
  int32_t used;         // bytes used in the current block
  int32_t numBlocks;
};

// A running output buffer: converted values are appended at base + used.
struct ConvRunBuf {
  char* base;
  int32_t used;
  int32_t remaining;
};

class ConvMgr {
 public:
  // items converters are pre-allocated; when they cannot be, message 543 and
  // the manager works without.
  explicit ConvMgr(int16_t items);
  ~ConvMgr();  // closes the manager's clones, frees its items and arenas
  ConvMgr(const ConvMgr&) = delete;
  ConvMgr& operator=(const ConvMgr&) = delete;

  // The manager's converter of a CCSID, cloned from the process's master
  // converter on first use. 0, 801, 1000 or 5000.
  int lookupAddConv(uint32_t ccsid, ConvListItem** item, int encoding);

  // The conversion core. Converts [*src, srcEnd) from srcCcsid to tgtCcsid.
  // With *tgt set, the output goes to [*tgt, tgtEnd) and *tgt is advanced
  // past it; with *tgt null the manager allocates the output, prefixed with
  // its byte length (32-bit with longLength, else 16-bit), and *tgt points at
  // the prefix. A NUL follows the output when room remains. On success *src
  // is advanced to srcEnd. quiet: no ICU messages; graphic: the data is
  // double-byte without shift bytes; extraSpace: 64 bytes more for a
  // manager-allocated output; flush: end of the data; reset: converters back
  // to their initial state afterwards. Answers 0, 801, 2002, 5001, 5003 or
  // an error of the converter lookup.
  int cpcv(uint32_t srcCcsid, const char** src, const char* srcEnd, uint32_t tgtCcsid,
           char** tgt, char* tgtEnd, int encoding, int longLength, int quiet, int graphic,
           int extraSpace, int flush, int reset);

  // Converts one character value of srcLen bytes (-1: up to the NUL; with
  // graphic, double-byte characters). With *tgt set, *len is its capacity in
  // and the bytes written out; with *tgt null, *tgt gets the manager's output
  // (behind its prefix) and *len its length (halved with halve). A value that
  // needs no conversion is copied, or handed back as it is when *tgt is null.
  int cpcvc(uint32_t srcCcsid, const char* src, uint32_t tgtCcsid, int16_t* len, char** tgt,
            int32_t srcLen, int encoding, int graphic, int halve);
  int cpcvl(uint32_t srcCcsid, const char* src, uint32_t tgtCcsid, int32_t* len, char** tgt,
            int32_t srcLen, int encoding, int graphic, int halve);
  // Appends srcLen bytes, converted, to the running buffer. 6024 when it has
  // less than srcLen + 2 bytes left or the output does not fit; the counts
  // change only on success.
  int cpcvb(uint32_t srcCcsid, uint32_t tgtCcsid, const char* src, int32_t srcLen,
            ConvRunBuf* buf, int encoding);

  // ICU's name of the manager's converter for a CCSID. 0 or an error (5000).
  int getName(uint32_t ccsid, const char** name, int encoding);

  // The CCSIDs of the manager's converters into buf (NUL-ended, cut to fit);
  // answers the characters written. The second form prints them.
  size_t printList(char* buf, size_t size) const;
  void printList() const;

  // Frees every output the manager allocated for its callers.
  void releaseOutputs();

  // Process-wide: a clone of the master converter of a CCSID (opened on
  // first use). 0, 801, 1000, 1005 or 5000.
  static int getConverter(uint32_t ccsid, UConverter** clone, int encoding);
  // Opens ICU's converter for a CCSID. 0 or 5000 (with message 568).
  static int openConverter(uint32_t ccsid, UConverter** conv, int encoding);
  // Closes every master converter and clone; conversions fail with 1000
  // from then on.
  static void cleanup();

 private:
  // cpcv, naming the manager's output `outWhat` in a memory message.
  int convert(uint32_t srcCcsid, const char** src, const char* srcEnd, uint32_t tgtCcsid,
              char** tgt, char* tgtEnd, int encoding, int longLength, int quiet, int graphic,
              int extraSpace, int flush, int reset, const char* outWhat);
  // cpcvc and cpcvl: maxLen is the longest length the caller's field holds.
  int convertValue(uint32_t srcCcsid, const char* src, uint32_t tgtCcsid, int32_t* len,
                   char** tgt, int32_t srcLen, int encoding, int graphic, int halve,
                   int longLength, int32_t maxLen, const char* origin);

  int16_t itemCapacity_;
  ConvListItem* freeItems_ = nullptr;
  ConvListItem* itemArray_ = nullptr;
  ConvListItem* inUse_ = nullptr;
  int32_t inUseCount_ = 0;
  ConvArena out_;   // outputs allocated for callers
  ConvArena temp_;  // the UTF-16 text of one conversion
};

// The attributes of a CCSID: its character CCSID and companion CCSID, and
// for 37, 500, 1047 and 1208 a converter name ("unknown" otherwise). Answers
// 823 for the pure double-byte CCSIDs, 0 otherwise.
int getCcsidInfo(uint32_t ccsid, uint32_t* charCcsid, uint32_t* companion, const char** name);
