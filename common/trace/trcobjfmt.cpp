#include "common/trace/trcobjfmt.h"

#include <cinttypes>
#include <cstring>
#include <ctime>

#include "common/platform/hsv.h"
#include "common/trace/trcprint.h"

namespace {

constexpr const char* kIndent = "\n         ";  // every line of object data
constexpr size_t kSqldaText = 20000;             // the SQLDA listing's text
constexpr size_t kStatementText = 4000;          // the statement listing's text
constexpr int kStatementLine = 70;

// An object that does not hold what its type needs: say so and dump it.
void damaged(FILE* out, const uint8_t* data, uint32_t length, const char* why) {
  fprintf(out, "(damaged: %s) ", why);
  trcHexDump(out, data, length);
}

void tooShort(FILE* out, const uint8_t* data, uint32_t length) {
  char why[64];
  snprintf(why, sizeof why, "%" PRIu32 " bytes are too few for its type", length);
  damaged(out, data, length, why);
}

template <typename T>
T load(const uint8_t* p) {
  T v;
  memcpy(&v, p, sizeof v);
  return v;
}

// The integer of types 1, 13, 16, 21 and 22: one byte unsigned, two bytes
// signed (or unsigned), else the first four bytes. False when the object is
// too short for the four.
bool readInteger(const uint8_t* data, uint32_t length, bool signedShort, int32_t* v) {
  if (length == 1) *v = data[0];
  else if (length == 2) *v = signedShort ? load<int16_t>(data) : load<uint16_t>(data);
  else if (length >= 4) *v = load<int32_t>(data);
  else return false;
  return true;
}

// Lower-case hexadecimal of the little-endian value of 1 to 8 bytes, with
// leading zeros to two digits a byte. False for any other length.
bool putPointer(FILE* out, const uint8_t* data, uint32_t length) {
  if (length == 0 || length > 8) return false;
  static const char kDigits[] = "0123456789abcdef";
  char text[16];
  for (uint32_t i = 0; i < length; ++i) {
    uint8_t b = data[length - 1 - i];
    text[2 * i] = kDigits[b >> 4];
    text[2 * i + 1] = kDigits[b & 15];
  }
  trcPutn(out, text, 2 * length);
  return true;
}

bool anyByteSet(const uint8_t* data, uint32_t length) {
  for (uint32_t i = 0; i < length; ++i)
    if (data[i] != 0) return true;
  return false;
}

void formatInteger(FILE* out, const uint8_t* data, uint32_t length, bool isSigned) {
  int32_t v;
  if (!readInteger(data, length, isSigned, &v)) return tooShort(out, data, length);
  trcPuts(out, kIndent);
  trcPutInt(out, v);
  putc_unlocked('\n', out);
}

// Lines of a string object, the first opening and the last closing a quote.
// The text ends at its first NUL or after its last byte.
void formatString(FILE* out, const uint8_t* data, uint32_t length) {
  const char* s = reinterpret_cast<const char*>(data);
  size_t n = strnlen(s, length);
  const char* quote = "\"";
  for (;;) {
    const char* nl = static_cast<const char*>(memchr(s, '\n', n));
    trcPuts(out, kIndent);
    trcPuts(out, quote);
    quote = "";
    if (nl == nullptr) break;
    trcPutn(out, s, static_cast<size_t>(nl - s));
    n -= static_cast<size_t>(nl - s) + 1;
    s = nl + 1;
  }
  trcPutn(out, s, n);
  trcPuts(out, "\"\n");
}

void formatSqlca(FILE* out, const uint8_t* data, uint32_t length) {
  trcHexDump(out, data, length);
  if (length < 16) {
    fprintf(out, "%s(no sqlcode: %" PRIu32 " bytes are too few)\n", kIndent, length);
    return;
  }
  fprintf(out, "%ssqlcode: %d\n", kIndent, load<int32_t>(data + 12));
}

// SQL descriptor: the column count at byte 14, then 56-byte column entries
// from byte 16: type (0), length or precision and scale (2, 3), name length
// (24) and up to 30 name bytes (26).
constexpr uint32_t kSqldaHeader = 16, kSqlvarSize = 56, kSqlvarName = 26, kSqlvarNameMax = 30;

void formatSqlda(FILE* out, const uint8_t* data, uint32_t length) {
  char why[96];
  if (length < kSqldaHeader) return tooShort(out, data, length);
  int16_t columns = load<int16_t>(data + 14);
  uint64_t needed = kSqldaHeader + static_cast<uint64_t>(columns < 0 ? 0 : columns) * kSqlvarSize;
  if (columns < 0 || needed > length) {
    snprintf(why, sizeof why, "SQLDA of %d columns needs %" PRIu64 " bytes, it holds %" PRIu32,
             columns, needed, length);
    return damaged(out, data, length, why);
  }
  for (int i = 0; i < columns; ++i) {
    uint16_t nameLength = load<uint16_t>(data + kSqldaHeader + i * kSqlvarSize + 24);
    if (nameLength > kSqlvarNameMax) {
      snprintf(why, sizeof why, "SQLDA column %d has a name of %u bytes, at most %" PRIu32 " fit",
               i + 1, nameLength, kSqlvarNameMax);
      return damaged(out, data, length, why);
    }
  }
  char text[kSqldaText];
  size_t used = static_cast<size_t>(snprintf(
      text, sizeof text,
      "\n         SQLDA: numCols= %d\n                type  length  colname\n"
      "                ----  ------  -------\n",
      columns));
  for (int i = 0; i < columns; ++i) {
    const uint8_t* col = data + kSqldaHeader + i * kSqlvarSize;
    int16_t type = load<int16_t>(col);
    uint16_t nameLength = load<uint16_t>(col + 24);
    const char* name = reinterpret_cast<const char*>(col + kSqlvarName);
    if (used + nameLength + 56 >= kSqldaText) {
      snprintf(text + used, sizeof text - used, "         ...buffer full\n");
      break;
    }
    int n = (type & ~1) == 484
                ? snprintf(text + used, sizeof text - used, "                %-4d  %-2d,%-2d   %.*s\n",
                           type, col[2], col[3], nameLength, name)
                : snprintf(text + used, sizeof text - used, "                %-4d  %-6d  %.*s\n",
                           type, load<uint16_t>(col + 2), nameLength, name);
    used += static_cast<size_t>(n);
  }
  trcPuts(out, text);
}

// Statement text cut into tokens that end just after a blank, a comma or a
// parenthesis, set in lines shorter than 70 characters; a token of 70 or
// more is a line of its own.
void formatStatement(FILE* out, const uint8_t* data, uint32_t length) {
  const char* s = reinterpret_cast<const char*>(data);
  size_t n = strnlen(s, length);
  char text[kStatementText];
  size_t used = 0;
  text[used++] = '\n';
  text[used] = '\0';
  auto addLine = [&](const char* line, size_t len) {
    if (used + 9 + len + 1 >= kStatementText) {
      static const char kFull[] = "...buffer full\n";
      if (used + sizeof kFull - 1 < kStatementText) memcpy(text + used, kFull, sizeof kFull);
      return false;
    }
    memset(text + used, ' ', 9);
    memcpy(text + used + 9, line, len);
    used += 9 + len;
    text[used++] = '\n';
    text[used] = '\0';
    return true;
  };
  const char* line = s;
  size_t lineLength = 0;
  size_t at = 0;
  bool room = true;
  while (room && at < n) {
    size_t end = at;
    while (end < n && !strchr(" ,()", s[end])) ++end;
    if (end < n) ++end;
    size_t token = end - at;
    if (lineLength > 0 && lineLength + token >= kStatementLine) {
      room = addLine(line, lineLength);
      lineLength = 0;
    }
    if (room && lineLength == 0 && token >= kStatementLine) {
      room = addLine(s + at, token);
    } else if (room) {
      if (lineLength == 0) line = s + at;
      lineLength += token;
    }
    at = end;
  }
  if (room && lineLength > 0) addLine(line, lineLength);
  trcPuts(out, text);
}

void formatTimestamp(FILE* out, const uint8_t* data, uint32_t length) {
  if (length < 16) return tooShort(out, data, length);
  int64_t seconds = load<int64_t>(data);
  int32_t micro = load<int32_t>(data + 12);
  struct tm tm;
  char when[64];
  if (!hsvTimeLocalTime(seconds, &tm) ||
      strftime(when, sizeof when, "%Y-%m-%d %H:%M:%S.", &tm) == 0) {
    fprintf(out, "%s%" PRId64 " seconds %d microseconds (no calendar time)\n", kIndent, seconds,
            micro);
    return;
  }
  fprintf(out, "%s%s%06d\n", kIndent, when, micro);
}

const char* adminMessageName(int32_t v) {
  static const char* const kNames[] = {
      "KLPXQ_TODO_NOTHING",      "KLPXQ_TODO_INVALIDATE_SUB",     "KLPXQ_TODO_INVALIDATE_QUEUE",
      "KLPXQ_TODO_LOADDONE",     "KLPXQ_TODO_ACTIVATE_SUB",       "KLPXQ_TODO_INVALIDATE_P2P_SUB",
  };
  return v >= 0 && v < 6 ? kNames[v] : "KLPXQ_TODO_UNKNOWN";
}

}  // namespace

void trcHexDump(FILE* out, const uint8_t* data, uint32_t length) {
  static const char kDigits[] = "0123456789abcdef";
  trcPuts(out, "(hex dump)");
  for (uint32_t at = 0; at < length; at += 16) {
    char line[10 + 36 + 2 + 16 + 1];
    char* p = line;
    memcpy(p, kIndent, 10);
    p += 10;
    for (uint32_t i = 0; i < 16; ++i) {
      if (at + i < length) {
        *p++ = kDigits[data[at + i] >> 4];
        *p++ = kDigits[data[at + i] & 15];
      } else {
        *p++ = ' ';
        *p++ = ' ';
      }
      if (i % 4 == 3) *p++ = ' ';
    }
    *p++ = ' ';
    *p++ = '|';
    for (uint32_t i = 0; i < 16; ++i) {
      uint8_t c = at + i < length ? data[at + i] : ' ';
      *p++ = c >= 0x20 && c < 0x7F ? static_cast<char>(c) : '.';
    }
    *p++ = '|';
    trcPutn(out, line, static_cast<size_t>(p - line));
  }
  putc_unlocked('\n', out);
}

void trcFormatObject(FILE* out, unsigned type, uint32_t length, const uint8_t* data, bool hex) {
  if (hex) return trcHexDump(out, data, length);
  switch (type) {
    case TRC_OBJ_SIGNED:
    case TRC_OBJ_SQLSTMT_TYPE: return formatInteger(out, data, length, true);
    case TRC_OBJ_RC:
    case TRC_OBJ_UNSIGNED: return formatInteger(out, data, length, false);
    case TRC_OBJ_TRCSTRING:
    case TRC_OBJ_STRING: return formatString(out, data, length);
    case TRC_OBJ_SQLCA: return formatSqlca(out, data, length);
    case TRC_OBJ_SQLDA: return formatSqlda(out, data, length);
    case TRC_OBJ_SQLSTMT: return formatStatement(out, data, length);
    case TRC_OBJ_NULL:
      if (length < 2) return tooShort(out, data, length);
      fprintf(out, "%sNULL pointer for object of type \"%s\"\n", kIndent,
              trcObjectTypeName(load<uint16_t>(data)));
      return;
    case TRC_OBJ_BOOL:
      trcPuts(out, kIndent);
      trcPuts(out, anyByteSet(data, length) ? "TRUE\n" : "FALSE\n");
      return;
    case TRC_OBJ_POINTER:
      if (length == 0 || length > 8) return tooShort(out, data, length);
      trcPuts(out, kIndent);
      trcPuts(out, "0x");
      putPointer(out, data, length);
      putc_unlocked('\n', out);
      return;
    case TRC_OBJ_TIMESTAMP: return formatTimestamp(out, data, length);
    case TRC_OBJ_ADMIN_MSG_TYPE: {
      int32_t v;
      if (!readInteger(data, length, true, &v)) return tooShort(out, data, length);
      fprintf(out, "%s\"%d\" equals %s\n", kIndent, v, adminMessageName(v));
      return;
    }
    default: return trcHexDump(out, data, length);
  }
}

void trcPutReturnValue(FILE* out, const trcObject& obj) {
  switch (obj.type) {
    case TRC_OBJ_RC: {
      int32_t v;
      if (!readInteger(obj.data, obj.length, false, &v)) {
        fprintf(out, "with return code of %u bytes, too few to read", obj.length);
        return;
      }
      trcPuts(out, "with return code ");
      trcPutInt(out, v);
      return;
    }
    case TRC_OBJ_BOOL:
      trcPuts(out, anyByteSet(obj.data, obj.length) ? "returning TRUE" : "returning FALSE");
      return;
    case TRC_OBJ_POINTER:
      trcPuts(out, "returning ptr 0x");
      if (!putPointer(out, obj.data, obj.length))
        fprintf(out, " (pointer of %u bytes, not readable)", obj.length);
      return;
    default: trcPuts(out, "UNSUPPORTED RETURN TYPE");
  }
}

const char* trcFullLevelText(uint16_t mask) {
  static const char* const kTexts[] = {"lvl 2", "lvl 3", "lvl 4", "lvl 5", "lvl 6"};
  for (int i = 0; i < 5; ++i)
    if (mask & (2u << i)) return kTexts[i];
  return "UNKNOWN DIAG LEVEL";
}

const char* trcFlowLevelText(uint16_t mask) {
  static const char* const kTexts[] = {"lvl 2", "lvl 3", "lvl 4"};
  for (int i = 0; i < 3; ++i)
    if (mask & (2u << i)) return kTexts[i];
  return "UNKNOWN DIAG LEVEL";
}
