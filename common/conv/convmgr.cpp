// The conversion manager: its converters, its two arenas and the conversion
// of data, values and running buffers.
#include "common/conv/convmgr.h"

#include <unicode/ucnv.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <vector>

#include "common/conv/convstate.h"
#include "common/msg/klplog.h"
#include "common/trace/trace.h"
#include "common/util/klprc.h"

struct ConvArenaBlock {
  ConvArenaBlock* next;
  size_t capacity;
  size_t spare;  // keeps the data 8-aligned behind a 24-byte header
  char* data() { return reinterpret_cast<char*>(this + 1); }
};
static_assert(sizeof(ConvArenaBlock) == 24, "arena block header");

namespace {

constexpr int kTrcComp = 42;
constexpr int kFnConstruct = 1;
constexpr int kFnCpcv = 13;
constexpr int32_t kStdCapacity = 32713;
// Four output bytes per source byte must stay far below ICU's int32 limits.
constexpr size_t kMaxSource = 0x8000000;

ConvArenaBlock* newArenaBlock(size_t capacity) {
  auto* b = static_cast<ConvArenaBlock*>(malloc(sizeof(ConvArenaBlock) + capacity));
  if (b) {
    b->next = nullptr;
    b->capacity = capacity;
  }
  return b;
}

void arenaInit(ConvArena* a) {
  a->stdCapacity = kStdCapacity;
  a->first = a->current = newArenaBlock(kStdCapacity);
  a->numBlocks = a->first ? 1 : 0;
  a->used = a->first ? 0 : kStdCapacity;
}

// What n bytes take: room for a NUL behind them, 8-aligned.
size_t arenaSize(size_t n) { return (n + 4 + 7) & ~static_cast<size_t>(7); }

char* arenaAlloc(ConvArena* a, size_t n) {
  size_t need = arenaSize(n);
  if (a->current && a->used + need <= a->current->capacity) {
    char* p = a->current->data() + a->used;
    a->used += static_cast<int32_t>(need);
    return p;
  }
  ConvArenaBlock* next = a->current ? a->current->next : a->first;
  if (next && need <= next->capacity) {
    a->current = next;
  } else {
    ConvArenaBlock* b = newArenaBlock(std::max(need, static_cast<size_t>(a->stdCapacity)));
    if (!b) return nullptr;
    if (a->current) {
      b->next = a->current->next;
      a->current->next = b;
    } else {
      b->next = a->first;
      a->first = b;
    }
    a->current = b;
    ++a->numBlocks;
  }
  a->used = static_cast<int32_t>(need);
  return a->current->data();
}

// Gives back the tail of the latest allocation p, keeping `keep` bytes of it
// (none: the whole allocation).
void arenaTrim(ConvArena* a, char* p, size_t keep) {
  if (!a->current) return;
  char* data = a->current->data();
  if (p < data || p >= data + a->used) return;
  size_t kept = static_cast<size_t>(p - data) + (keep ? arenaSize(keep) : 0);
  if (kept < static_cast<size_t>(a->used)) a->used = static_cast<int32_t>(kept);
}

// Back to the first block; blocks above the standard size are freed.
void arenaReset(ConvArena* a) {
  for (ConvArenaBlock** p = &a->first; *p;) {
    if ((*p)->capacity > static_cast<size_t>(a->stdCapacity)) {
      ConvArenaBlock* b = *p;
      *p = b->next;
      free(b);
      --a->numBlocks;
    } else {
      p = &(*p)->next;
    }
  }
  a->current = a->first;
  a->used = a->first ? 0 : a->stdCapacity;
}

void arenaFree(ConvArena* a) {
  while (ConvArenaBlock* b = a->first) {
    a->first = b->next;
    free(b);
  }
  a->current = nullptr;
  a->numBlocks = 0;
}

// A shift-out that no shift-in follows.
bool hasOpenShiftOut(const char* p, size_t n) {
  bool open = false;
  for (size_t i = 0; i < n; ++i) {
    if (static_cast<uint8_t>(p[i]) == CONV_SHIFT_OUT) open = true;
    else if (static_cast<uint8_t>(p[i]) == CONV_SHIFT_IN) open = false;
  }
  return open;
}

void printShifted(const char* title, const char* p, size_t n) {
  printf("%s (%d): ", title, static_cast<int>(n));
  for (size_t i = 0; i < n; ++i) printf("%02X", static_cast<uint8_t>(p[i]));
  printf("\n");
}

void reportNoMemory(const char* origin, size_t size, const char* what) {
  char text[24];
  snprintf(text, sizeof text, "%zu", size);
  logKlpMsg(543, origin, KLP_DEST_SEVERITY, text, nullptr, 1, what);
}

// The blank of a target code page, for padding.
char blankOf(UConverter* conv) {
  static const UChar kSpace[1] = {0x20};
  char out[8];
  UErrorCode err = U_ZERO_ERROR;
  int32_t n = ucnv_fromUChars(conv, out, sizeof out, kSpace, 1, &err);
  return U_SUCCESS(err) && n == 1 ? out[0] : ' ';
}

// The UTF-16 form of `in` into [out, out + units): 0, 5003 or 5001.
int toUtf16(ConvListItem* from, const char* in, size_t inLen, UChar* out, size_t units,
            size_t* written, int flush, int quiet) {
  UErrorCode err = U_ZERO_ERROR;
  UChar* t = out;
  const char* s = in;
  ucnv_toUnicode(from->conv, &t, out + units, &s, in + inLen, nullptr, flush != 0, &err);
  *written = static_cast<size_t>(t - out);
  if (err == U_BUFFER_OVERFLOW_ERROR) return CONV_RC_TOO_SMALL;
  if (U_FAILURE(err)) {
    if (!quiet && !convStrictApply())
      convReportIcu("ConvMgr::cpcv", "ucnv_toUnicode", from->ccsid, err);
    return CONV_RC_CONVERT;
  }
  return 0;
}

// UTF-16 [u, u + units) into [*w, end), advancing *w: 0, 5003 or 5001.
int fromUtf16(ConvListItem* to, const UChar* u, size_t units, char** w, char* end, int flush,
              int quiet) {
  UErrorCode err = U_ZERO_ERROR;
  ucnv_fromUnicode(to->conv, w, end, &u, u + units, nullptr, flush != 0, &err);
  if (err == U_BUFFER_OVERFLOW_ERROR) return CONV_RC_TOO_SMALL;
  if (U_FAILURE(err)) {
    if (!quiet && !convStrictApply())
      convReportIcu("ConvMgr::cpcv", "ucnv_fromUnicode", to->ccsid, err);
    return CONV_RC_CONVERT;
  }
  return 0;
}

bool isPreallocated(const ConvListItem* item, const ConvListItem* array, int16_t n) {
  return array && item >= array && item < array + n;
}

}  // namespace

bool convIsUtf16(uint32_t ccsid) {
  return ccsid == 1200 || ccsid == 1202 || ccsid == 13488 || ccsid == 13490 || ccsid == 17586;
}

ConvMgr::ConvMgr(int16_t items) : itemCapacity_(items > 0 ? items : 0) {
  trcEntry(kTrcComp, kFnConstruct);
  arenaInit(&out_);
  arenaInit(&temp_);
  if (itemCapacity_ > 0) {
    itemArray_ = static_cast<ConvListItem*>(calloc(itemCapacity_, sizeof(ConvListItem)));
    if (!itemArray_) {
      char size[16];
      snprintf(size, sizeof size, "%d", static_cast<int>(itemCapacity_ * sizeof(ConvListItem)));
      logKlpMsg(543, "ConvMgr::ConvMgr", KLP_DEST_SEVERITY, size, nullptr, 1, "ConvListItem");
      itemCapacity_ = 0;
    }
    for (int i = itemCapacity_ - 1; i >= 0; --i) {
      itemArray_[i].next = freeItems_;
      freeItems_ = &itemArray_[i];
    }
  }
  trcExit(kTrcComp, kFnConstruct, TRC_RET_NONE);
}

ConvMgr::~ConvMgr() {
  while (ConvListItem* item = inUse_) {
    inUse_ = item->next;
    convReleaseClone(item->conv);
    if (!isPreallocated(item, itemArray_, itemCapacity_)) free(item);
  }
  free(itemArray_);
  arenaFree(&out_);
  arenaFree(&temp_);
}

int ConvMgr::lookupAddConv(uint32_t ccsid, ConvListItem** out, int encoding) {
  *out = nullptr;
  ConvListItem* last = nullptr;
  for (ConvListItem* it = inUse_; it; it = it->next) {
    if (it->ccsid == ccsid && convStateAlive()) {
      *out = it;
      return 0;
    }
    last = it;
  }
  ConvListItem* item = freeItems_;
  if (item) {
    freeItems_ = item->next;
  } else if (!(item = static_cast<ConvListItem*>(malloc(sizeof(ConvListItem))))) {
    reportNoMemory("ConvMgr::lookupAddConv", sizeof(ConvListItem), "ConvListItem");
    return KLP_RC_NO_MEMORY;
  }
  int rc = getConverter(ccsid, &item->conv, encoding);
  if (rc != 0) {
    logInternalError("openConverter", rc, "getConverter");
    if (isPreallocated(item, itemArray_, itemCapacity_)) {
      item->next = freeItems_;
      freeItems_ = item;
    } else {
      free(item);
    }
    return rc;
  }
  item->ccsid = ccsid;
  item->next = nullptr;
  (last ? last->next : inUse_) = item;
  ++inUseCount_;
  *out = item;
  return 0;
}

int ConvMgr::cpcv(uint32_t srcCcsid, const char** src, const char* srcEnd, uint32_t tgtCcsid,
                  char** tgt, char* tgtEnd, int encoding, int longLength, int quiet, int graphic,
                  int extraSpace, int flush, int reset) {
  return convert(srcCcsid, src, srcEnd, tgtCcsid, tgt, tgtEnd, encoding, longLength, quiet,
                 graphic, extraSpace, flush, reset, "Target Codepage buffer");
}

int ConvMgr::convert(uint32_t srcCcsid, const char** src, const char* srcEnd, uint32_t tgtCcsid,
                     char** tgt, char* tgtEnd, int encoding, int longLength, int quiet,
                     int graphic, int extraSpace, int flush, int reset, const char* outWhat) {
  trcEntry(kTrcComp, kFnCpcv);
  if (!src || !tgt || (!*src && srcEnd) || srcEnd < *src || (*tgt && tgtEnd < *tgt) ||
      static_cast<size_t>(srcEnd - *src) > kMaxSource) {
    trcExitRc(kTrcComp, kFnCpcv, KLP_RC_BAD_PARM);
    return KLP_RC_BAD_PARM;
  }
  const size_t srcLen = static_cast<size_t>(srcEnd - *src);
  const bool wantOut = *tgt == nullptr;
  if (trcIsRunning()) {
    char text[320];
    int shown = static_cast<int>(std::min<size_t>(srcLen, 50));
    snprintf(text, sizeof text,
             "src CCSID: %d, targ CCSID: %d, encoding: %d, *srcBuffer: %d, srcBufferEnd: %d, "
             "*targBuffer: %d, targBufferEnd: %d, src[0..50] = \"%.*s\", output provided: %c",
             static_cast<int>(srcCcsid), static_cast<int>(tgtCcsid), encoding,
             static_cast<int>(reinterpret_cast<intptr_t>(*src)),
             static_cast<int>(reinterpret_cast<intptr_t>(srcEnd)),
             static_cast<int>(reinterpret_cast<intptr_t>(*tgt)),
             static_cast<int>(reinterpret_cast<intptr_t>(tgtEnd)), shown, shown ? *src : "",
             wantOut ? 'N' : 'Y');
    trcData(kTrcComp, kFnCpcv, "inputs", 2, 7, static_cast<uint32_t>(strlen(text)), text);
    trcData(kTrcComp, kFnCpcv, "cpcv hex input", 4, 0, static_cast<uint32_t>(srcLen), *src);
  }

  int rc = 0;
  const char* in = *src;
  size_t inLen = srcLen;
  ConvListItem* from = nullptr;
  ConvListItem* to = nullptr;
  char* resv = nullptr;
  const size_t prefix = longLength ? 4 : 2;
  char* out = *tgt;
  char* outEnd = tgtEnd;
  char* w = nullptr;

  // Korean mixed data whose last shift-out is never closed: converted as if
  // a shift-in ended it. Graphic data gets the shift bytes it lacks.
  if (srcCcsid == 933 && hasOpenShiftOut(in, inLen)) {
    char* copy = arenaAlloc(&temp_, inLen + 1);
    if (!copy) {
      reportNoMemory("fixBrokenData", inLen + 1, "Graphic SHIFT-IN buffer");
      logInternalError("fixBrokenData", KLP_RC_NO_MEMORY, "CHAR/VARCHAR");
      rc = KLP_RC_NO_MEMORY;
      goto done;
    }
    memcpy(copy, in, inLen);
    copy[inLen] = static_cast<char>(CONV_SHIFT_IN);
    in = copy;
    ++inLen;
    if (convParmBool(nullptr, 1)) printShifted("KOR: Data after adding SHIFT bytes", in, inLen);
  } else if (graphic && (srcCcsid == 834 || srcCcsid == 930 || srcCcsid == 939)) {
    char* copy = arenaAlloc(&temp_, inLen + 2);
    if (!copy) {
      reportNoMemory("addShiftBytesGraphic", inLen + 2, "Graphic SHIFT buffer");
      logInternalError("addShiftBytesToData", KLP_RC_NO_MEMORY, "GRAPHIC");
      rc = KLP_RC_NO_MEMORY;
      goto done;
    }
    copy[0] = static_cast<char>(CONV_SHIFT_OUT);
    if (inLen) memcpy(copy + 1, in, inLen);
    copy[inLen + 1] = static_cast<char>(CONV_SHIFT_IN);
    in = copy;
    inLen += 2;
    if (convParmBool(nullptr, 1)) printShifted("SOSI: Data after adding SHIFT bytes", in, inLen);
  }

  if (!convIsUtf16(srcCcsid) && (rc = lookupAddConv(srcCcsid, &from, encoding)) != 0) {
    logInternalError("ConvMgr::lookupAddConv", rc, "src converter");
    goto done;
  }
  if (!convIsUtf16(tgtCcsid) && (rc = lookupAddConv(tgtCcsid, &to, encoding)) != 0) {
    logInternalError("ConvMgr::lookupAddConv", rc, "targ converter");
    goto done;
  }

  if (wantOut) {
    size_t size = prefix + 4 * inLen + 2 + (extraSpace && !convIsUtf16(srcCcsid) ? 64 : 0);
    resv = arenaAlloc(&out_, size);
    if (!resv) {
      reportNoMemory("ConvMgr::cpcv", size, outWhat);
      rc = KLP_RC_NO_MEMORY;
      goto done;
    }
    out = resv + prefix;
    outEnd = resv + size;
  }
  w = out;

  if (!convIsUtf16(srcCcsid) && convIsUtf16(tgtCcsid)) {
    // Straight into the output when it is aligned for UTF-16.
    size_t room = static_cast<size_t>(outEnd - out) / 2;
    bool direct = reinterpret_cast<uintptr_t>(out) % alignof(UChar) == 0;
    UChar* u = direct ? reinterpret_cast<UChar*>(out)
                      : reinterpret_cast<UChar*>(arenaAlloc(&temp_, room * 2));
    size_t units = 0;
    if (!u) {
      reportNoMemory("ConvMgr::cpcv", room * 2, "Unicode buffer");
      rc = KLP_RC_NO_MEMORY;
      goto done;
    }
    rc = toUtf16(from, in, inLen, u, room, &units, flush, quiet);
    if (rc != 0) goto done;
    if (!direct) memcpy(out, u, units * 2);
    w = out + units * 2;
    if (outEnd - w >= 2) memset(w, 0, 2);
  } else if (!convIsUtf16(srcCcsid)) {
    size_t bytes = 4 * inLen + 2 + prefix;
    UChar* u = reinterpret_cast<UChar*>(arenaAlloc(&temp_, bytes));
    size_t units = 0;
    if (!u) {
      reportNoMemory("ConvMgr::cpcv", bytes, "Unicode buffer");
      rc = KLP_RC_NO_MEMORY;
      goto done;
    }
    rc = toUtf16(from, in, inLen, u, bytes / 2, &units, flush, quiet);
    if (rc == 0) rc = fromUtf16(to, u, units, &w, outEnd, 1, quiet);
  } else if (convIsUtf16(tgtCcsid)) {
    size_t room = static_cast<size_t>(outEnd - out);
    memmove(out, in, std::min(inLen, room));
    if (inLen > room) {
      rc = CONV_RC_TOO_SMALL;
      goto done;
    }
    w = out + inLen;
    if (outEnd - w >= 2) memset(w, 0, 2);
  } else {
    const UChar* u = reinterpret_cast<const UChar*>(in);
    if (inLen % 2 != 0) {
      // Half a UTF-16 unit cannot be converted.
      if (!quiet && !convStrictApply())
        convReportIcu("ConvMgr::cpcv", "ucnv_fromUnicode", srcCcsid, U_TRUNCATED_CHAR_FOUND);
      rc = CONV_RC_CONVERT;
      goto done;
    }
    if (reinterpret_cast<uintptr_t>(in) % alignof(UChar) != 0) {
      char* copy = arenaAlloc(&temp_, inLen);
      if (!copy) {
        reportNoMemory("ConvMgr::cpcv", inLen, "Unicode buffer");
        rc = KLP_RC_NO_MEMORY;
        goto done;
      }
      memcpy(copy, in, inLen);
      u = reinterpret_cast<const UChar*>(copy);
    }
    rc = fromUtf16(to, u, inLen / 2, &w, outEnd, flush, quiet);
  }
  if (rc != 0) goto done;

  if (srcCcsid == 834 && graphic && to) {
    // Three output bytes for every two source bytes, the rest blanks.
    size_t want = srcLen / 2 * 3;
    if (static_cast<size_t>(w - out) < want && w < outEnd) {
      char blank = blankOf(to->conv);
      while (static_cast<size_t>(w - out) < want && w < outEnd) *w++ = blank;
    }
  }
  if (w < outEnd && !convIsUtf16(tgtCcsid)) *w = '\0';
  if (wantOut) {
    size_t bytes = static_cast<size_t>(w - out);
    if (!longLength && bytes > INT16_MAX) {
      rc = CONV_RC_TOO_SMALL;
      goto done;
    }
    if (longLength) {
      int32_t n = static_cast<int32_t>(bytes);
      memcpy(resv, &n, sizeof n);
    } else {
      int16_t n = static_cast<int16_t>(bytes);
      memcpy(resv, &n, sizeof n);
    }
    arenaTrim(&out_, resv, prefix + bytes + 2);
    *tgt = resv;
  } else {
    *tgt = w;
  }
  *src = srcEnd;
  trcData(kTrcComp, kFnCpcv, "cpcv hex output", 4, 0, static_cast<uint32_t>(w - out), out);

done:
  if (rc != 0 && wantOut) {
    if (resv) arenaTrim(&out_, resv, 0);
    *tgt = nullptr;
    if (rc != CONV_RC_TOO_SMALL && !convStrictApply()) {
      char s[16], t[16];
      snprintf(s, sizeof s, "%i", static_cast<int>(srcCcsid));
      snprintf(t, sizeof t, "%i", static_cast<int>(tgtCcsid));
      logKlpMsg(619, "ConvMgr::cpcv", KLP_DEST_SEVERITY, s, nullptr, 1, t);
    }
  }
  // Back to the initial shift state between values.
  if (from && reset) ucnv_reset(from->conv);
  if (to && (reset || !from)) ucnv_reset(to->conv);
  arenaReset(&temp_);
  trcExitRc(kTrcComp, kFnCpcv, rc);
  return rc;
}

int ConvMgr::convertValue(uint32_t srcCcsid, const char* src, uint32_t tgtCcsid, int32_t* len,
                          char** tgt, int32_t srcLen, int encoding, int graphic, int halve,
                          int longLength, int32_t maxLen, const char* origin) {
  if (!len || !tgt || (!src && srcLen != 0)) return KLP_RC_BAD_PARM;
  size_t bytes = srcLen < 0 ? strlen(src) : static_cast<size_t>(srcLen) * (graphic ? 2 : 1);
  bool needed = srcCcsid != 0 && (srcCcsid != tgtCcsid ||
                                   ((srcCcsid == 1200 || srcCcsid == 13488) && !(encoding & 1)));
  if (!needed) {
    if (*tgt) {
      size_t room = *len > 0 ? static_cast<size_t>(*len) : 0;
      size_t n = std::min(bytes, room);
      memmove(*tgt, src, n);
      if (n < room) (*tgt)[n] = '\0';
      *len = static_cast<int32_t>(n);
      return bytes > room ? CONV_RC_TOO_SMALL : 0;
    }
    size_t given = srcLen < 0 ? bytes : static_cast<size_t>(srcLen);
    if (given > static_cast<size_t>(maxLen)) return CONV_RC_TOO_SMALL;
    *tgt = const_cast<char*>(src);
    *len = static_cast<int32_t>(given);
    return 0;
  }
  const char* s = src;
  char* t = *tgt;
  char* end = t ? t + std::max<int32_t>(*len, 0) : nullptr;
  int rc = convert(srcCcsid, &s, src + bytes, tgtCcsid, &t, end, encoding, longLength, 0, graphic,
                   0, 1, 1, longLength ? "getPtr4" : "Target Codepage buffer");
  if (rc == 0 && !*tgt) {
    int32_t n;
    if (longLength) {
      memcpy(&n, t, sizeof n);
    } else {
      int16_t n16;
      memcpy(&n16, t, sizeof n16);
      n = n16;
    }
    *len = halve ? n / 2 : n;
    *tgt = t + (longLength ? 4 : 2);
  } else if (rc == 0) {
    *len = static_cast<int32_t>(t - *tgt);
  } else if (!convStrictApply()) {
    logInternalError(origin, rc, "do conversion");
  }
  return rc;
}

int ConvMgr::cpcvc(uint32_t srcCcsid, const char* src, uint32_t tgtCcsid, int16_t* len,
                   char** tgt, int32_t srcLen, int encoding, int graphic, int halve) {
  if (!len) return KLP_RC_BAD_PARM;
  int32_t n = *len;
  int rc = convertValue(srcCcsid, src, tgtCcsid, &n, tgt, srcLen, encoding, graphic, halve, 0,
                        INT16_MAX, "ConvMgr::cpcvc");
  if (rc == 0 || *tgt) *len = static_cast<int16_t>(n);
  return rc;
}

int ConvMgr::cpcvl(uint32_t srcCcsid, const char* src, uint32_t tgtCcsid, int32_t* len,
                   char** tgt, int32_t srcLen, int encoding, int graphic, int halve) {
  return convertValue(srcCcsid, src, tgtCcsid, len, tgt, srcLen, encoding, graphic, halve, 1,
                      INT32_MAX, "ConvMgr::cpcvl");
}

int ConvMgr::cpcvb(uint32_t srcCcsid, uint32_t tgtCcsid, const char* src, int32_t srcLen,
                   ConvRunBuf* buf, int encoding) {
  if (!buf || !buf->base || buf->used < 0 || srcLen < 0 || (!src && srcLen != 0))
    return KLP_RC_BAD_PARM;
  if (buf->remaining < 0 || static_cast<int64_t>(buf->remaining) < int64_t{srcLen} + 2)
    return CONV_RC_RUNBUF;
  char* start = buf->base + buf->used;
  char* t = start;
  const char* s = src;
  int rc = cpcv(srcCcsid, &s, src + srcLen, tgtCcsid, &t, start + buf->remaining, encoding, 0, 0,
                0, 0, 1, 1);
  if (rc == 0) {
    buf->used += static_cast<int32_t>(t - start);
    buf->remaining -= static_cast<int32_t>(t - start);
  } else if (rc == CONV_RC_TOO_SMALL) {
    rc = CONV_RC_RUNBUF;
  } else if (!convStrictApply()) {
    logInternalError("ConvMgr::cpcvb", rc, "cpcv");
  }
  return rc;
}

int ConvMgr::getName(uint32_t ccsid, const char** name, int encoding) {
  *name = nullptr;
  ConvListItem* item = nullptr;
  int rc = lookupAddConv(ccsid, &item, encoding);
  if (rc != 0) return rc;
  UErrorCode err = U_ZERO_ERROR;
  const char* n = ucnv_getName(item->conv, &err);
  if (U_FAILURE(err)) {
    convReportIcu("ConvMgr::getName", "ucnv_getName", ccsid, err);
    return CONV_RC_ICU;
  }
  *name = n;
  return 0;
}

size_t ConvMgr::printList(char* buf, size_t size) const {
  if (!buf || size == 0) return 0;
  size_t n = 0;
  buf[0] = '\0';
  auto put = [&](const char* text) {
    size_t len = std::min(strlen(text), size - 1 - n);
    memcpy(buf + n, text, len);
    n += len;
    buf[n] = '\0';
  };
  if (!inUse_) {
    put("No converters in the list.\n");
    put("\n");
    return n;
  }
  put("List: ");
  for (const ConvListItem* it = inUse_; it; it = it->next) {
    if (size - 1 - n < 10) continue;
    char item[16];
    snprintf(item, sizeof item, "%d ", static_cast<int>(it->ccsid));
    put(item);
  }
  put("\n");
  return n;
}

void ConvMgr::printList() const {
  std::vector<char> buf(32 + 12 * static_cast<size_t>(inUseCount_));
  printList(buf.data(), buf.size());
  fputs(buf.data(), stdout);
}

void ConvMgr::releaseOutputs() { arenaReset(&out_); }
