// Small output helpers of the trace formatters. Formatting a large trace
// prints millions of short pieces, so the hot ones skip printf's parsing and
// the stream lock (the caller holds it with flockfile for a whole run).
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstring>

inline void trcPutn(FILE* out, const char* s, size_t n) { fwrite_unlocked(s, 1, n, out); }
inline void trcPuts(FILE* out, const char* s) { trcPutn(out, s, strlen(s)); }
// At most max bytes of s, up to its first NUL: a field that may fill its
// whole width without a terminator.
inline void trcPutField(FILE* out, const char* s, size_t max) { trcPutn(out, s, strnlen(s, max)); }

// Decimal digits of v into the end of buf[24]; answers where they start.
inline char* trcDecimal(int64_t v, char* end) {
  uint64_t u = v < 0 ? 0 - static_cast<uint64_t>(v) : static_cast<uint64_t>(v);
  char* p = end;
  do {
    *--p = static_cast<char>('0' + u % 10);
    u /= 10;
  } while (u != 0);
  if (v < 0) *--p = '-';
  return p;
}
inline void trcPutInt(FILE* out, int64_t v) {
  char buf[24];
  char* p = trcDecimal(v, buf + sizeof buf);
  trcPutn(out, p, static_cast<size_t>(buf + sizeof buf - p));
}
// "%d" of v followed by blanks up to a width of 8 (a record number).
inline void trcPutNumber8(FILE* out, int64_t v) {
  char buf[32];
  char* end = buf + 24;
  char* p = trcDecimal(v, end);
  while (end - p < 8) *end++ = ' ';
  trcPutn(out, p, static_cast<size_t>(end - p));
}
// "%d.%06d" of an entry or exit record's time.
inline void trcPutTime(FILE* out, int32_t seconds, int32_t microseconds) {
  trcPutInt(out, seconds);
  putc_unlocked('.', out);
  if (microseconds >= 0 && microseconds < 1000000) {
    char buf[6];
    int32_t m = microseconds;
    for (int i = 5; i >= 0; --i, m /= 10) buf[i] = static_cast<char>('0' + m % 10);
    trcPutn(out, buf, 6);
  } else {
    fprintf(out, "%06d", microseconds);
  }
}
