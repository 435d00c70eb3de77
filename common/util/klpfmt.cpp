// Formatting and time helpers.
#include "common/util/klpfmt.h"

#include <cctype>
#include <cerrno>
#include <cinttypes>
#include <climits>
#include <cstdarg>
#include <cstdlib>
#include <cstring>
#include <ctime>

#include <atomic>

#include "common/env/klpenv.h"
#include "common/msg/klplog.h"
#include "common/parms/klpparm.h"
#include "common/platform/hsv.h"
#include "common/trace/trace.h"
#include "common/util/klprc.h"

namespace {

const char* orEmpty(const char* s) { return s ? s : ""; }

// Writes the identifier when `needed` (the family's bound) is below the
// buffer size; otherwise the "buffer full" notice or nothing. The text is
// produced by `emit` into a work buffer first so a partial identifier can
// never reach the caller.
int finishInto(char* buf, size_t size, size_t needed, const char* text) {
  if (buf == nullptr || size == 0) return 0;
  if (size > needed) {
    size_t n = strlen(text);
    if (n >= size) n = size - 1;  // cannot happen while the bounds hold
    memcpy(buf, text, n);
    buf[n] = '\0';
    return static_cast<int>(n);
  }
  if (size >= 17) {
    strcpy(buf, KLP_BUFFER_FULL);
    return static_cast<int>(strlen(KLP_BUFFER_FULL));
  }
  return 0;
}

void printBounded(size_t needed, const char* text) {
  if (KLP_PRINT_WORK_SIZE > needed)
    fputs(text, stdout);
  else
    fputs(KLP_BUFFER_FULL, stdout);
}

// The identifier texts themselves. Each bound leaves room for the longest
// form, so a work buffer of bound + 1 always holds the result.

size_t affixLen(const char* prefix, const char* suffix) {
  return strlen(orEmpty(prefix)) + strlen(orEmpty(suffix));
}

char* wordsText(const char* prefix, const uint8_t* lp, const char* suffix, size_t* needed) {
  *needed = affixLen(prefix, suffix) + 36;
  char* t = static_cast<char*>(malloc(*needed + 1));
  if (!t) return nullptr;
  unsigned w[5];
  for (int k = 0; k < 5; ++k) w[k] = lp[2 * k] * 256u + lp[2 * k + 1];
  snprintf(t, *needed + 1, "%s%04x:%04x:%04x:%04x:%04x%s", orEmpty(prefix), w[0], w[1], w[2],
           w[3], w[4], orEmpty(suffix));
  return t;
}

char* bytesText(const char* prefix, const uint8_t* lp, const char* suffix, size_t* needed,
                bool newline) {
  *needed = affixLen(prefix, suffix) + 41;
  char* t = static_cast<char*>(malloc(*needed + 1));
  if (!t) return nullptr;
  snprintf(t, *needed + 1, "%s%02x%02x:%02x%02x:%02x%02x:%02x%02x:%02x%02x%s%s", orEmpty(prefix),
           lp[0], lp[1], lp[2], lp[3], lp[4], lp[5], lp[6], lp[7], lp[8], lp[9], orEmpty(suffix),
           newline ? "\n" : "");
  return t;
}

int16_t varIdCount(const void* varId) {
  int16_t n;
  memcpy(&n, varId, sizeof n);
  return n < 0 ? 0 : n;
}

char* varIdText(const char* prefix, const void* varId, const char* suffix, size_t* needed) {
  int count = varIdCount(varId);
  const uint8_t* b = static_cast<const uint8_t*>(varId) + sizeof(int16_t);
  *needed = affixLen(prefix, suffix) + 2 * count + count / 2 + 15;
  char* t = static_cast<char*>(malloc(*needed + 1));
  if (!t) return nullptr;
  // Bytes past the count are not the identifier's: show them as 00 rather
  // than reading beyond it.
  auto at = [&](int i) -> unsigned { return i < count ? b[i] : 0u; };
  size_t pos = static_cast<size_t>(
      snprintf(t, *needed + 1, "%s%02x%02x", orEmpty(prefix), at(0), at(1)));
  for (int i = 2; i < count && pos < *needed; i += 2)
    pos += static_cast<size_t>(snprintf(t + pos, *needed + 1 - pos, ":%02x%02x", at(i), at(i + 1)));
  if (pos < *needed) snprintf(t + pos, *needed + 1 - pos, "%s", orEmpty(suffix));
  return t;
}

char* pairText(const char* prefix, uint16_t a, uint16_t b, const char* suffix, size_t* needed) {
  *needed = affixLen(prefix, suffix) + 25;
  char* t = static_cast<char*>(malloc(*needed + 1));
  if (!t) return nullptr;
  snprintf(t, *needed + 1, "%s%04d:%04d%s", orEmpty(prefix), a, b, orEmpty(suffix));
  return t;
}

char* lsnText(const char* prefix, const uint8_t* lsn, const char* suffix, size_t* needed) {
  *needed = affixLen(prefix, suffix) + 16;
  char* t = static_cast<char*>(malloc(*needed + 1));
  if (!t) return nullptr;
  size_t pos = static_cast<size_t>(snprintf(t, *needed + 1, "%s", orEmpty(prefix)));
  for (int i = 0; i < 8; ++i) pos += static_cast<size_t>(snprintf(t + pos, 3, "%02x", lsn[i]));
  snprintf(t + pos, *needed + 1 - pos, "%s", orEmpty(suffix));
  return t;
}

int intoBuffer(char* buf, size_t size, char* text, size_t needed) {
  if (!text) {
    if (buf && size) buf[0] = '\0';
    return 0;
  }
  int n = finishInto(buf, size, needed, text);
  free(text);
  return n;
}

void toStdout(char* text, size_t needed) {
  if (!text) return;
  printBounded(needed, text);
  free(text);
}

// Reads the decimal number at text[pos] up to the next non-digit, never past
// len. A run of digits beyond what an int holds gives -1.
int numberAt(const char* text, size_t len, size_t pos) {
  int v = 0;
  for (size_t i = pos; i < len && isdigit(static_cast<unsigned char>(text[i])); ++i) {
    int digit = text[i] - '0';
    if (v > (INT_MAX - digit) / 10) return -1;
    v = v * 10 + digit;
  }
  return v;
}

int writeOut(char* buf, size_t size, const char* fmt, ...) __attribute__((format(printf, 3, 4)));
int writeOut(char* buf, size_t size, const char* fmt, ...) {
  if (!buf || size == 0) return 0;
  va_list ap;
  va_start(ap, fmt);
  int n = vsnprintf(buf, size, fmt, ap);
  va_end(ap);
  if (n < 0) {
    buf[0] = '\0';
    return 0;
  }
  return static_cast<size_t>(n) >= size ? static_cast<int>(size - 1) : n;
}

}  // namespace

// ---------------------------------------------------------------------------
// Identifiers
// ---------------------------------------------------------------------------
int formatLogPosWords(char* buf, size_t size, const char* prefix, const uint8_t* logPos,
                      const char* suffix) {
  size_t needed;
  char* t = wordsText(prefix, logPos, suffix, &needed);
  return intoBuffer(buf, size, t, needed);
}

void printLogPosWords(const char* prefix, const uint8_t* logPos, const char* suffix) {
  size_t needed;
  char* t = wordsText(prefix, logPos, suffix, &needed);
  toStdout(t, needed);
}

int formatLogPosBytes(char* buf, size_t size, const char* prefix, const uint8_t* logPos,
                      const char* suffix) {
  size_t needed;
  char* t = bytesText(prefix, logPos, suffix, &needed, false);
  return intoBuffer(buf, size, t, needed);
}

void printLogPosBytes(const char* prefix, const uint8_t* logPos, const char* suffix) {
  size_t needed;
  char* t = bytesText(prefix, logPos, suffix, &needed, true);
  toStdout(t, needed);
}

int formatVarId(char* buf, size_t size, const char* prefix, const void* varId,
                const char* suffix) {
  size_t needed;
  char* t = varIdText(prefix, varId, suffix, &needed);
  return intoBuffer(buf, size, t, needed);
}

void printVarId(const char* prefix, const void* varId, const char* suffix) {
  size_t needed;
  char* t = varIdText(prefix, varId, suffix, &needed);
  toStdout(t, needed);
}

int formatNumPair(char* buf, size_t size, const char* prefix, uint16_t first, uint16_t second,
                  const char* suffix) {
  size_t needed;
  char* t = pairText(prefix, first, second, suffix, &needed);
  return intoBuffer(buf, size, t, needed);
}

void printNumPair(const char* prefix, uint16_t first, uint16_t second, const char* suffix) {
  size_t needed;
  char* t = pairText(prefix, first, second, suffix, &needed);
  toStdout(t, needed);
}

int formatLsn(char* buf, size_t size, const char* prefix, const uint8_t* lsn, const char* suffix) {
  size_t needed;
  char* t = lsnText(prefix, lsn, suffix, &needed);
  if (!t) {
    if (buf && size) buf[0] = '\0';
    return 0;
  }
  bool fits = buf && size > needed;
  int n = finishInto(buf, size, needed, t);
  free(t);
  return fits ? 16 : n;
}

void printLsn(const char* prefix, const uint8_t* lsn, const char* suffix) {
  size_t needed;
  char* t = lsnText(prefix, lsn, suffix, &needed);
  toStdout(t, needed);
}

// ---------------------------------------------------------------------------
// Hexadecimal text
// ---------------------------------------------------------------------------
int formatHex(const void* varId, char* buf, size_t size) {
  int count = varIdCount(varId);
  if (!buf || size < static_cast<size_t>(2 * count + 1)) {
    // The platform's assertion report; the caller carries on without text.
    fprintf(stderr, "Assertion failed: %s, file %s, line %d\n",
            "Buffer passed to formatHex is too small", "klputil", 508);
    fflush(stderr);
    return -1;
  }
  const uint8_t* b = static_cast<const uint8_t*>(varId) + sizeof(int16_t);
  for (int i = 0; i < count; ++i) snprintf(buf + 2 * i, 3, "%02X", b[i]);
  buf[2 * count] = '\0';
  return 2 * count;
}

int formatHexUpper(const void* data, size_t n, char* buf, size_t size) {
  if (!buf || size < 2 * n + 1) return -1;
  const uint8_t* b = static_cast<const uint8_t*>(data);
  for (size_t i = 0; i < n; ++i) snprintf(buf + 2 * i, 3, "%02X", b[i]);
  buf[2 * n] = '\0';
  return static_cast<int>(2 * n);
}

void hexDump(size_t count, const void* addr, FILE* stream, bool showAddress) {
  if (!stream || (!addr && count)) return;
  const uint8_t* p = static_cast<const uint8_t*>(addr);
  constexpr size_t kPerLine = 20;
  for (size_t line = 0; line < count; line += kPerLine) {
    size_t n = count - line < kPerLine ? count - line : kPerLine;
    if (showAddress)
      fprintf(stream, " %*.*lx ", 8, 8, static_cast<unsigned long>(reinterpret_cast<uintptr_t>(p + line)));
    for (size_t i = 0; i < kPerLine; ++i) {
      if (i < n)
        fprintf(stream, "%2.2X", p[line + i]);
      else
        fputs("  ", stream);
      if (i % 4 == 3) fputc(' ', stream);
    }
    fputc(' ', stream);
    for (size_t i = 0; i < n; ++i) {
      unsigned char c = p[line + i];
      fputc(isprint(c) ? c : '.', stream);
    }
    fputc('\n', stream);
  }
}

// ---------------------------------------------------------------------------
// Timestamps
// ---------------------------------------------------------------------------
int timestamp2seconds(const char* text, int64_t* seconds, int32_t* micros) {
  size_t len = text ? strlen(text) : 0;
  if (len != KLP_TIMESTAMP_LEN && len != KLP_TIMESTAMP_US_LEN) {
    // The log line ends itself; a line feed in the text would only show
    // escaped.
    char line[80];
    snprintf(line, sizeof line, "Expected timestamp len of 19 or 26. Received %d",
             static_cast<int>(len));
    logKlpMsg(-1, "timestamp2seconds", KLP_DEST_LOG, line, nullptr, 0);
    return -1;
  }
  const int year = numberAt(text, len, 0), month = numberAt(text, len, 5);
  struct tm tm {};
  tm.tm_year = year - 1900;
  tm.tm_mon = month - 1;
  tm.tm_mday = numberAt(text, len, 8);
  tm.tm_hour = numberAt(text, len, 11);
  tm.tm_min = numberAt(text, len, 14);
  tm.tm_sec = numberAt(text, len, 17);
  tm.tm_isdst = -1;  // daylight saving is the local-time conversion's to decide
  int32_t us = len == KLP_TIMESTAMP_US_LEN ? numberAt(text, len, 20) : 0;
  // A field too long for a number is not a time: conversion fails for it.
  bool overflow = year < 0 || month < 0 || tm.tm_mday < 0 || tm.tm_hour < 0 || tm.tm_min < 0 ||
                  tm.tm_sec < 0;
  time_t t = overflow ? static_cast<time_t>(-1) : mktime(&tm);
  if (t == static_cast<time_t>(-1)) {
    if (seconds) *seconds = 0;
    if (micros) *micros = us;
    logKlpMsg(-1, "timestamp2seconds", KLP_DEST_LOG, "mktime could not calculate seconds",
              nullptr, 0);
    return -1;
  }
  if (seconds) *seconds = static_cast<int64_t>(t);
  if (micros) *micros = us;
  return 0;
}

int formatLocalTimestamp(int64_t seconds, int32_t micros, char* buf, size_t size, bool iso) {
  if (seconds == 0 && !iso) return writeOut(buf, size, "%s", "Un-initialized");
  struct tm tm {};
  if (!hsvTimeLocalTime(seconds, &tm)) return writeOut(buf, size, "%s", "");
  long us = micros;
  if (micros >= 1) {
    if (iso)
      return writeOut(buf, size, "%04d-%02d-%02dT%02d:%02d:%02d.%06ld", tm.tm_year + 1900,
                      tm.tm_mon + 1, tm.tm_mday, tm.tm_hour, tm.tm_min, tm.tm_sec, us);
    return writeOut(buf, size, "%02d-%02d-%04d %02d:%02d:%02d.%06ld", tm.tm_mon + 1, tm.tm_mday,
                    tm.tm_year + 1900, tm.tm_hour, tm.tm_min, tm.tm_sec, us);
  }
  if (iso)
    return writeOut(buf, size, "%04d-%02d-%02dT%02d:%02d:%02d", tm.tm_year + 1900, tm.tm_mon + 1,
                    tm.tm_mday, tm.tm_hour, tm.tm_min, tm.tm_sec);
  return writeOut(buf, size, "%02d-%02d-%04d %02d:%02d:%02d", tm.tm_mon + 1, tm.tm_mday,
                  tm.tm_year + 1900, tm.tm_hour, tm.tm_min, tm.tm_sec);
}

int formatUtcTimestamp(int64_t seconds, int32_t micros, char* buf, size_t size, char style) {
  if (style != 'C' && style != 'X' && style != 'D') return 0;
  if (style == 'C' && seconds == 0) return writeOut(buf, size, "%s", "Un-initialized");
  struct tm tm {};
  if (!hsvTimeGmTime(seconds, &tm)) return writeOut(buf, size, "%s", "");
  long us = micros;
  int y = tm.tm_year + 1900, mo = tm.tm_mon + 1;
  switch (style) {
    case 'C':
      if (micros >= 1)
        return writeOut(buf, size, "%02d-%02d-%04d %02d:%02d:%02d.%06ld", mo, tm.tm_mday, y,
                        tm.tm_hour, tm.tm_min, tm.tm_sec, us);
      return writeOut(buf, size, "%02d-%02d-%04d %02d:%02d:%02d", mo, tm.tm_mday, y, tm.tm_hour,
                      tm.tm_min, tm.tm_sec);
    case 'X':
      if (micros >= 1)
        return writeOut(buf, size, "%04d-%02d-%02dT%02d:%02d:%02d.%06ld", y, mo, tm.tm_mday,
                        tm.tm_hour, tm.tm_min, tm.tm_sec, us);
      return writeOut(buf, size, "%04d-%02d-%02dT%02d:%02d:%02d", y, mo, tm.tm_mday, tm.tm_hour,
                      tm.tm_min, tm.tm_sec);
    default:
      return writeOut(buf, size, "%04d-%02d-%02d-%02d.%02d.%02d", y, mo, tm.tm_mday, tm.tm_hour,
                      tm.tm_min, tm.tm_sec);
  }
}

void secondsToTimestamp(int64_t seconds, char* out) {
  if (!out) return;
  struct tm tm {};
  if (!hsvTimeLocalTime(seconds, &tm) || strftime(out, 20, "%Y-%m-%d-%H.%M.%S", &tm) == 0)
    out[0] = '\0';
}

namespace {
// Ors the nibbles of `bcd` into the digit positions of a template.
void orNibbles(const uint8_t* bcd, char* out, const int* positions, int digits) {
  for (int d = 0; d < digits; ++d) {
    uint8_t byte = bcd[d / 2];
    uint8_t nib = (d % 2 == 0) ? (byte >> 4) : (byte & 0x0F);
    out[positions[d]] = static_cast<char>(out[positions[d]] | nib);
  }
}
}  // namespace

void bcdDateToText(const uint8_t* bcd, char* out) {
  static const int pos[8] = {0, 1, 2, 3, 5, 6, 8, 9};
  memcpy(out, "0000-00-00", 10);
  orNibbles(bcd, out, pos, 8);
}

void bcdTimeToText(const uint8_t* bcd, char* out) {
  static const int pos[6] = {0, 1, 3, 4, 6, 7};
  memcpy(out, "00.00.00", 8);
  orNibbles(bcd, out, pos, 6);
}

int bcdTimestampToText(const uint8_t* bcd, size_t bcdLen, int fracLen, int precision, char* out) {
  if (!bcd || !out || bcdLen < 7) return -1;
  static const int pos[14] = {0, 1, 2, 3, 5, 6, 8, 9, 11, 12, 14, 15, 17, 18};
  memcpy(out, "0000-00-00-00.00.00", 19);
  orNibbles(bcd, out, pos, 14);
  if (fracLen < 1) return 19;
  out[19] = '.';
  memset(out + 20, '0', static_cast<size_t>(fracLen));
  // More than six fraction digits only from programs of level 9.7 on.
  const klpReleaseBlock& rel = klpGetEnv()->appVersion.rel;
  int p = (rel.version > 9 || (rel.version == 9 && rel.release >= 7)) ? precision : 6;
  size_t available = (bcdLen - 7) * 2;
  size_t take = static_cast<size_t>(p < 0 ? 0 : p);
  if (take > static_cast<size_t>(fracLen)) take = static_cast<size_t>(fracLen);
  if (take > available) take = available;
  for (size_t d = 0; d < take; ++d) {
    uint8_t byte = bcd[7 + d / 2];
    uint8_t nib = (d % 2 == 0) ? (byte >> 4) : (byte & 0x0F);
    out[20 + d] = static_cast<char>('0' | nib);
  }
  return 20 + fracLen;
}

// ---------------------------------------------------------------------------
// Durations
// ---------------------------------------------------------------------------
int formatDuration(int64_t seconds, char* buf, size_t size) {
  int64_t d = seconds / 86400, rest = seconds % 86400;
  return writeOut(buf, size, "%3dd %2dh %2dm %2ds", static_cast<int>(d),
                  static_cast<int>(rest / 3600), static_cast<int>(rest % 3600 / 60),
                  static_cast<int>(rest % 60));
}

int formatMillis(uint64_t millis, char* buf, size_t size) {
  uint64_t secs = millis / 1000;
  return writeOut(buf, size, "%2" PRIu64 "h %2dm %2d.%03ds", secs / 3600,
                  static_cast<int>(secs % 3600 / 60), static_cast<int>(secs % 60),
                  static_cast<int>(millis % 1000));
}

int formatMillis32(uint32_t millis, char* buf, size_t size) {
  return formatMillis(millis, buf, size);
}

// ---------------------------------------------------------------------------
// Strings and names
// ---------------------------------------------------------------------------
int copyStringIntoBuffer(char* dst, const char* src, size_t size) {
  if (!dst || !src) return KLP_RC_BAD_PARM;
  size_t len = strlen(src);
  if (size == 0 || len > size - 1) {
    logKlpMsg(569, "copyStringIntoBuffer", KLP_DEST_LOG, "String size exeeds buffer size",
              nullptr, 0);
    return KLP_RC_TOO_LONG;
  }
  memcpy(dst, src, len + 1);
  return KLP_OK;
}

int checkIdentifier(char* name, int32_t* length) {
  if (!name) return KLP_RC_BAD_PARM;
  size_t len = strlen(name);
  if (name[0] == '"') {
    if (len < 2 || name[len - 1] != '"') return KLP_RC_BAD_PARM;
    int32_t n = 0;
    for (size_t i = 1; i < len - 1; ++i) {
      if (name[i] == '"') {
        if (i + 1 >= len - 1 || name[i + 1] != '"') return KLP_RC_BAD_PARM;
        ++i;  // a doubled quote stands for one
      }
      ++n;
    }
    if (length) *length = n;
    return KLP_OK;
  }
  if (strchr(name, '"')) return KLP_RC_BAD_PARM;
  for (size_t i = 0; i < len; ++i)
    name[i] = static_cast<char>(toupper(static_cast<unsigned char>(name[i])));
  if (length) *length = static_cast<int32_t>(len);
  return KLP_OK;
}

int searchWordSequence(int32_t length, const char* text, int count, const klpWord* words) {
  if (!text || !words || count <= 0 || length <= 0) return 0;
  auto isSep = [](char c) { return c == ' ' || c == '\t' || c == '\n' || c == '\r'; };
  auto lower = [](char c) { return tolower(static_cast<unsigned char>(c)); };
  int w = 0;
  int k = 0;
  // Empty words match at once.
  auto skipEmpty = [&]() {
    while (w < count && (words[w].length <= 0 || !words[w].text)) ++w;
    return w >= count;
  };
  if (skipEmpty()) return 1;
  for (int32_t i = 0; i < length; ++i) {
    char c = text[i];
    if (isSep(c)) {
      if (k > 0) {  // a word was cut by a separator: start over
        w = 0;
        k = 0;
        skipEmpty();
      }
      continue;
    }
    if (lower(c) != lower(words[w].text[k])) {
      w = 0;
      k = 0;
      skipEmpty();
      // The character that broke the match may begin the first word.
      if (lower(c) != lower(words[w].text[0])) continue;
    }
    if (++k == words[w].length) {
      ++w;
      k = 0;
      if (skipEmpty()) return 1;
    }
  }
  return 0;
}

int getPadChar(int32_t ccsid, char* out) {
  if (!out) return KLP_RC_UNKNOWN_CCSID;
  switch (ccsid) {
    case 1208:
    case 1209:
    case 947:
    case 1252:
      out[0] = ' ';
      return 1;
    case 1200:
      out[0] = 0x30;
      out[1] = 0x00;
      return 2;
    case 37:
    case 273:
    case 277:
    case 278:
    case 285:
    case 424:
    case 500:
      out[0] = '@';
      return 1;
    case 941:
      out[0] = static_cast<char>(0x81);
      out[1] = 0x40;
      return 2;
    default:
      return KLP_RC_UNKNOWN_CCSID;
  }
}

int getCompatibilityLevel() {
  static std::atomic<int> kept{-1};
  int v = kept.load();
  if (v >= 0) return v;
  klpEnv* env = klpGetEnv();
  klpParmClass* parms = klpGetCurrentParms();
  const char* name = getEnvProgramName(env);
  if (!parms || name[0] == '\0') return 1;  // not known yet: do not keep
  v = 1;
  if (strcmp(name, "xqpub") == 0 && parms->getCount() > 33) {
    const char* level = parms->getParmString(33);
    if (level && (!strcmp(level, "0905") || !strcmp(level, "0901") || !strcmp(level, "0802")))
      v = 0;
  }
  kept.store(v);
  return v;
}

// ---------------------------------------------------------------------------
// Program files
// ---------------------------------------------------------------------------
int getFileHandle(FILE** fh, uint32_t flags, const char* suffix, char* nameOut, size_t nameSize,
                  char* errOut, size_t errSize) {
  trcEntry(11, 94);
  if (fh) *fh = nullptr;
  if (nameOut && nameSize) nameOut[0] = '\0';
  if (errOut && errSize) errOut[0] = '\0';
  char mode[8];
  char type = (flags & KLP_FILE_BINARY) ? 'b' : 't';
  if (flags & (KLP_FILE_WRITE | KLP_FILE_APPEND))
    snprintf(mode, sizeof mode, "%c%c+", (flags & KLP_FILE_APPEND) ? 'a' : 'w', type);
  else
    snprintf(mode, sizeof mode, "r%c", type);

  klpEnv* env = klpGetEnv();
  char name[KLP_ENV_PATH_MAX];
  int n;
  if (flags & KLP_FILE_TEMP) {
    n = snprintf(name, sizeof name, "%s%s.%d.%s", getEnvIPCDir(env), getEnvJobName(env),
                 static_cast<int>(hsvProcessID()), orEmpty(suffix));
  } else {
    klpParmClass* parms = klpGetCurrentParms();
    const char* path = parms ? parms->getParmString(PARM_IDX_PATH) : nullptr;
    const char* prefix = getEnvNamePrefix(env);
    n = snprintf(name, sizeof name, "%s%s.%s", orEmpty(path), orEmpty(prefix), orEmpty(suffix));
  }
  int err = 0;
  FILE* f = nullptr;
  if (n < 0 || static_cast<size_t>(n) >= sizeof name || (nameOut && static_cast<size_t>(n) >= nameSize)) {
    err = ENAMETOOLONG;  // a cut name would open some other file
  } else {
    f = fopen(name, mode);
    if (!f) err = errno ? errno : EIO;
  }
  if (!f) {
    char errText[16];
    snprintf(errText, sizeof errText, "%d", err);
    logKlpMsg(626, "getFileHandle", KLP_DEST_SEVERITY, "fopen", nullptr, 3, name, mode, errText);
    trcExitRc(11, 94, err);
    return err;
  }
  trcData(11, 94, "file opened", 2, 7, static_cast<uint32_t>(strlen(name)), name, 7,
          static_cast<uint32_t>(strlen(mode)), mode);
  if (fh) *fh = f;
  else fclose(f);
  if (nameOut) memcpy(nameOut, name, static_cast<size_t>(n) + 1);
  trcData(11, 94, "returned file", 2, 7, static_cast<uint32_t>(strlen(name)), name);
  trcExitRc(11, 94, 0);
  return 0;
}

// ---------------------------------------------------------------------------
// Wildcard criteria
// ---------------------------------------------------------------------------
int32_t prepareIgnTransCriteria(char* pattern) {
  if (!pattern) return KLP_WILD_NONE;
  // Reduce runs of "%" to one; escapes stay for now.
  size_t r = 0, w = 0;
  bool afterPercent = false;  // the last character kept is an unescaped "%"
  while (pattern[r]) {
    char c = pattern[r++];
    if (c == '\\') {
      pattern[w++] = c;
      if (pattern[r]) pattern[w++] = pattern[r++];
      afterPercent = false;
      continue;
    }
    if (c == '%' && afterPercent) continue;
    afterPercent = c == '%';
    pattern[w++] = c;
  }
  pattern[w] = '\0';
  if (strcmp(pattern, "%") == 0) return KLP_WILD_ALL;
  // Find the unescaped "%" signs.
  int count = 0;
  bool lastIsPercent = false;
  for (size_t i = 0; pattern[i]; ++i) {
    if (pattern[i] == '\\') {
      if (pattern[i + 1]) ++i;
      lastIsPercent = false;
      continue;
    }
    lastIsPercent = pattern[i] == '%';
    if (lastIsPercent) ++count;
  }
  int32_t kind = count == 0 ? KLP_WILD_NONE
                 : (count == 1 && lastIsPercent) ? KLP_WILD_PREFIX
                                                 : KLP_WILD_FULL;
  if (kind == KLP_WILD_NONE || kind == KLP_WILD_PREFIX) {
    // Exact and prefix criteria are compared literally: drop the escapes.
    size_t i = 0, o = 0;
    while (pattern[i]) {
      if (pattern[i] == '\\' && pattern[i + 1]) ++i;
      pattern[o++] = pattern[i++];
    }
    pattern[o] = '\0';
  }
  return kind;
}

// Its trace row: the last of component 6 ("Capture Transactions").
constexpr int kTrcIgnTrans = 6, kFnIgnTrans = 53;

int compareIgnTransCriteria(const char* pattern, const char* text) {
  trcEntry(kTrcIgnTrans, kFnIgnTrans);
  int result = 0;
  if (!pattern || !text) {
    trcExitRc(kTrcIgnTrans, kFnIgnTrans, 0);
    return 0;
  }
  const char* p = pattern;
  const char* t = text;
  // Only the latest "%" is ever returned to, so one backtrack point suffices.
  const char* backP = nullptr;
  const char* backT = nullptr;
  if (*p == '\0') {
    result = *t == '\0';
  } else {
    for (;;) {
      if (*p == '%') {
        while (*p == '%') ++p;  // a run of "%" is one
        if (*p == '\0') {
          result = 1;
          break;
        }
        // The character to look for: after a backslash, the escaped one.
        char want = *p;
        if (want == '\\') {
          if (p[1] == '\0') break;
          want = p[1];
        }
        const char* hit = strchr(t, want);
        if (!hit || want == '\0') break;
        t = hit;
        backP = p - 1;
        backT = t;
        continue;
      }
      if (*p == '\0') {
        result = *t == '\0';
        // The pattern ended before the text: the last "%" may have taken too
        // little ("A%C" against "ABCC"), so try it one character longer. A
        // match means the whole text matches, as the caller is promised.
        if (!result && backP) {
          p = backP;
          t = backT + 1;
          backP = nullptr;
          continue;
        }
        break;
      }
      char want = *p;
      const char* next = p + 1;
      if (want == '\\') {
        if (p[1] == '\0') break;  // a backslash ending the pattern matches nothing
        want = p[1];
        next = p + 2;
      }
      if (*t != '\0' && *t == want) {
        ++t;
        p = next;
        continue;
      }
      if (!backP) break;
      p = backP;
      t = backT + 1;
      backP = nullptr;
    }
  }
  trcExitRc(kTrcIgnTrans, kFnIgnTrans, result);
  return result;
}
