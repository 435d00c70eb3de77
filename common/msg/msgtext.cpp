// Message texts: header values, the built-in table, composition, the
// substitution of "$1".."$9" and the generated message-definitions header.
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <new>

#include "common/msg/msglogger.h"
#include "common/platform/hsv.h"
#include "common/util/klprc.h"

namespace {

bool isDigits(const char* p, int n) {
  for (int i = 0; i < n; ++i)
    if (p[i] < '0' || p[i] > '9') return false;
  return true;
}

int fourDigits(const char* p) {
  return (p[0] - '0') * 1000 + (p[1] - '0') * 100 + (p[2] - '0') * 10 + (p[3] - '0');
}

enum HeaderKind { HEADER_NONE, HEADER_QT, HEADER_APP_QT };

HeaderKind headerKind(int n) {
  if ((n >= 0 && n <= 499) || (n >= 1000 && n <= 1499) || (n >= 5100 && n <= 5199))
    return HEADER_QT;
  if ((n >= 500 && n <= 999) || (n >= 1976 && n <= 1999) || (n >= 4000 && n <= 4099) ||
      (n >= 7000 && n <= 8997))
    return HEADER_APP_QT;
  return HEADER_NONE;
}

// How a byte of a value is written in a message text: control characters
// escaped, so that no value can end or split the line its message goes on
// (a queue name a client sent may hold a line feed). Answers the characters
// written into out (room for 4 and a NUL), or only counts them when out is
// null.
size_t escapeByte(unsigned char c, char* out) {
  const char* named = c == '\n' ? "\\n" : c == '\r' ? "\\r" : c == '\t' ? "\\t" : nullptr;
  if (named != nullptr) {
    if (out != nullptr) memcpy(out, named, 2);
    return 2;
  }
  if (c < 0x20 || c == 0x7F) {
    if (out != nullptr) snprintf(out, 5, "\\x%02X", c);
    return 4;
  }
  if (out != nullptr) *out = static_cast<char>(c);
  return 1;
}

// A value's copy as it is substituted; *len gets its length.
char* copyValue(const char* value, size_t* len) {
  size_t n = 0;
  for (const char* p = value; *p != '\0'; ++p) n += escapeByte(static_cast<unsigned char>(*p), nullptr);
  char* c = new (std::nothrow) char[n + 1];
  if (c == nullptr) return nullptr;
  // The terminator's place gives the last escape room for its NUL.
  size_t at = 0;
  for (const char* p = value; *p != '\0'; ++p) at += escapeByte(static_cast<unsigned char>(*p), c + at);
  c[n] = '\0';
  *len = n;
  return c;
}

// Puts a copy of value in front of the record's values; when nine are held
// the last one is dropped first.
bool pushFront(logMsg* r, const char* value) {
  size_t n = 0;
  char* copy = copyValue(value, &n);
  if (copy == nullptr) {
    r->error = KLP_RC_NO_MEMORY;
    return false;
  }
  if (r->valueCount >= MSG_MAX_VALUES) {
    delete[] r->values[MSG_MAX_VALUES - 1];
    r->values[MSG_MAX_VALUES - 1] = nullptr;
    r->valueCount = MSG_MAX_VALUES - 1;
  }
  for (int i = r->valueCount; i > 0; --i) {
    r->values[i] = r->values[i - 1];
    r->valueLengths[i] = r->valueLengths[i - 1];
  }
  r->values[0] = copy;
  r->valueLengths[0] = n;
  r->valueCount++;
  return true;
}

// Process-wide state of the generated header (a development aid).
FILE* headerFile = nullptr;
int headerOpenFailureReported = 0;

}  // namespace

// ---------------------------------------------------------------------------
// Built-in table
// ---------------------------------------------------------------------------
int msgLogger::addBuiltinMsg(const char* def) {
  if (def == nullptr || strncmp(def, "KLP", 3) != 0) return 0;
  if (strnlen(def, 8) < 7 || !isDigits(def + 3, 4)) return 0;
  int number = fourDigits(def + 3);
  if (number < 1 || number > 9998) return 0;
  int b = number % MSG_BUCKETS;
  for (BuiltinNode* n = buckets_[b]; n != nullptr; n = n->next)
    if (strncmp(n->definition, def, 7) == 0) return 0;
  BuiltinNode* node = new (std::nothrow) BuiltinNode;
  if (node == nullptr) return 0;
  node->definition = def;
  node->next = buckets_[b];
  buckets_[b] = node;
  return 1;
}

int msgLogger::loadBuiltinMsgs(const char* const* table) {
  int added = 0;
  if (table == nullptr) return 0;
  for (; *table != nullptr; ++table) added += addBuiltinMsg(*table);
  return added;
}

int msgLogger::lookupBuiltinMsg(int number, int size, logMsg* r) {
  if (number < 0 || number > 9999) return 0;
  char key[8];
  snprintf(key, sizeof key, "KLP%04d", number);
  const char* def = nullptr;
  for (BuiltinNode* n = buckets_[number % MSG_BUCKETS]; n != nullptr; n = n->next) {
    if (strncmp(n->definition, key, 7) == 0) {
      def = n->definition;
      break;
    }
  }
  if (def == nullptr) return 0;
  if (size < 1 || r == nullptr) return 1;
  const char* text = def;
  if (def[7] == '~') {
    // An override row must name its external id; a malformed one is used
    // as an extension row rather than read beyond its end.
    if (strnlen(def, 17) >= 17 && strncmp(def + 9, "KLP", 3) == 0 && isDigits(def + 12, 4)) {
      r->sourceKind = MSG_SOURCE_OVERRIDE;
      r->internalNumber = number;
      r->msgNumber = fourDigits(def + 12);
      addHeaderValues(r);
      boundValues(r);
      text = def + 9;
    } else {
      r->sourceKind = MSG_SOURCE_EXTENSION;
    }
  } else {
    r->sourceKind = MSG_SOURCE_EXTENSION;
  }
  if (r->text != nullptr) {
    size_t cap = static_cast<size_t>(size < r->textSize ? size : r->textSize);
    size_t n = strnlen(text, cap);
    memcpy(r->text, text, n);
    r->text[n] = '\0';
  }
  return 1;
}

// ---------------------------------------------------------------------------
// Values
// ---------------------------------------------------------------------------
void msgLogger::setMsgValues(logMsg* r, int count, const char* const* values) {
  int n = count < MSG_MAX_VALUES ? count : MSG_MAX_VALUES;
  for (int i = 0; i < n && r->valueCount < MSG_MAX_VALUES; ++i) {
    const char* v = (values != nullptr && values[i] != nullptr) ? values[i] : "*";
    size_t len = 0;
    char* copy = copyValue(v, &len);
    if (copy == nullptr) {
      r->error = KLP_RC_NO_MEMORY;
      return;
    }
    r->values[r->valueCount] = copy;
    r->valueLengths[r->valueCount] = len;
    r->valueCount++;
  }
  if (r->threadName[0] == '\0' || r->threadName[0] == ' ') {
    const char* name = defaultThreadName();
    size_t k = 0;
    if (name != nullptr)
      for (; k < MSG_THREAD_NAME_MAX && name[k] != '\0'; ++k) r->threadName[k] = name[k];
    r->threadName[k] = '\0';
  }
  addHeaderValues(r);
  if (r->error == 0) boundValues(r);
}

void msgLogger::addHeaderValues(logMsg* r) {
  HeaderKind kind = headerKind(r->msgNumber);
  if (kind == HEADER_NONE) return;
  char qt[MSG_QUALIFIER_MAX + MSG_THREAD_NAME_MAX + 8];
  qualifierAndThread(r->threadName, qt, sizeof qt);
  if (!pushFront(r, qt)) return;
  if (kind == HEADER_APP_QT) pushFront(r, getApplicationName());
}

void msgLogger::boundValues(logMsg* r) {
  if (r->valueCount == 0) return;
  uint64_t sum = 0;
  for (int i = 0; i < r->valueCount; ++i) sum += r->valueLengths[i];
  if (sum <= static_cast<uint64_t>(MSG_MAX_VALUES_LENGTH)) return;
  uint64_t share = MSG_MAX_VALUES_LENGTH / r->valueCount;
  int64_t excess = static_cast<int64_t>(sum - MSG_MAX_VALUES_LENGTH);
  uint64_t longCount = 0;
  for (int i = 0; i < r->valueCount; ++i)
    if (r->valueLengths[i] > share) ++longCount;
  if (longCount == 0) return;
  uint64_t cut = static_cast<uint64_t>(excess) / longCount;
  for (int i = 0; i < r->valueCount && excess >= 1; ++i) {
    if (r->valueLengths[i] <= share) continue;
    // Never cut more than the value holds.
    uint64_t c = cut < r->valueLengths[i] ? cut : r->valueLengths[i];
    r->valueLengths[i] -= c;
    r->values[i][r->valueLengths[i]] = '\0';
    excess -= static_cast<int64_t>(c);
  }
}

// ---------------------------------------------------------------------------
// Substitution
// ---------------------------------------------------------------------------
int msgSubstitute(const char* tmpl, size_t tmplLen, char* const* values, int count, char* out,
                  int capacity) {
  if (out == nullptr) return 0;
  size_t cap = capacity > 0 ? static_cast<size_t>(capacity) : 0;
  size_t used = 0;
  size_t pos = 0;
  bool full = false;
  auto append = [&](const char* s, size_t n) {
    size_t room = cap - used;
    if (n > room) n = room;
    memcpy(out + used, s, n);
    used += n;
  };
  for (int i = 1; i <= MSG_MAX_VALUES && !full; ++i) {
    char marker[2] = {'$', static_cast<char>('0' + i)};
    size_t at = pos;
    bool found = false;
    for (; at + 1 < tmplLen; ++at) {
      if (tmpl[at] == marker[0] && tmpl[at + 1] == marker[1]) {
        found = true;
        break;
      }
    }
    if (!found) break;
    const char* v = "*";
    if (i <= count && values != nullptr && values[i - 1] != nullptr && values[i - 1][0] != '\0')
      v = values[i - 1];
    size_t vl = strlen(v);
    size_t before = at - pos;
    if (used + before + vl >= cap) full = true;
    append(tmpl + pos, before);
    append(v, vl);
    pos = at + 2;
  }
  if (!full && pos < tmplLen) append(tmpl + pos, tmplLen - pos);
  out[used] = '\0';
  return static_cast<int>(used);
}

void msgLogger::substituteValues(logMsg* r) {
  if (r->text == nullptr) return;
  char* work = new (std::nothrow) char[static_cast<size_t>(r->textSize) + 1];
  if (work == nullptr) {
    r->error = KLP_RC_NO_MEMORY;
    return;
  }
  int n = msgSubstitute(r->text, strlen(r->text), r->values, r->valueCount, work, r->textSize);
  memcpy(r->text, work, static_cast<size_t>(n) + 1);
  delete[] work;
}

// ---------------------------------------------------------------------------
// Composition
// ---------------------------------------------------------------------------
void msgLogger::composeInternalError(logMsg* r) {
  int asIssued = r->msgNumber;
  r->sourceKind = MSG_SOURCE_NONE;
  r->msgNumber = 553;
  r->severity = 'W';
  if (r->text == nullptr) return;
  snprintf(r->text, static_cast<size_t>(r->textSize) + 1,
           "KLP0553W  \"%s\" : \"%s\" : \"%s\" : An internal error  \"4\" occurred for message "
           "number \"%d\" containing \"%d\" substitution fields: \"$1\", \"$2\", \"$3\", \"$4\", "
           "\"$5\", \"$6\", \"$7\", \"$8\", \"$9\"",
           getApplicationName(), qualifier_, r->threadName, asIssued, r->valueCount);
}

void msgLogger::composeKlpMsg(logMsg* r) {
  bool found = false;
  if (r->msgNumber < 8000 || r->msgNumber > 8997) {
    if (r->text != nullptr && getCatalogMsg(r->msgNumber, r->textSize, r->text) != 0) {
      r->sourceKind = MSG_SOURCE_CATALOG;
      found = true;
    }
  }
  if (!found) found = lookupBuiltinMsg(r->msgNumber, r->textSize, r) != 0;
  if (!found) composeInternalError(r);
  substituteValues(r);
}

void msgLoggerU::composeKlpMsg(logMsg* r) {
  if (r->text == nullptr) return;
  if (r->msgNumber < 8000) {
    int n = retrieveCatalogMsg(catalogName_, r->msgNumber, r->valueLengths, r->values,
                               r->valueCount, r->text, r->textSize + 1);
    if (n > 0) {
      if (r->text[n - 1] == '\n') r->text[n - 1] = '\0';
      r->sourceKind = MSG_SOURCE_CATALOG;
      return;
    }
    int reason = 0;
    if (r->text[0] != ':') {
      const char* colon = strchr(r->text, ':');
      if (colon != nullptr && strnlen(colon, 3) == 3) reason = atoi(colon + 3);
    }
    if ((reason == 2 || reason == 3) && !catalogFailureReported_) {
      logMsg* e = msgNewRecord(513, MSG_ROUTE_BY_SEVERITY, "composeKlpMsg", " ");
      if (e != nullptr && e->text != nullptr) {
        char qt[MSG_QUALIFIER_MAX + MSG_THREAD_NAME_MAX + 8];
        qualifierAndThread(e->threadName, qt, sizeof qt);
        snprintf(e->text, static_cast<size_t>(e->textSize) + 1,
                 "%s KLP0513E \"%s\":\"%s\": The program could not open the message file named "
                 "'%s', Reason: %s",
                 e->timestamp, getApplicationName(), qt, catalogName_, r->text);
        e->severity = 'E';
        writeStderr(e);
        writeLogFile(e);
      }
      msgFreeRecord(e);
      catalogFailureReported_ = 1;
    }
    r->text[0] = '\0';
  }
  if (lookupBuiltinMsg(r->msgNumber, r->textSize, r) == 0) composeInternalError(r);
  substituteValues(r);
}

// ---------------------------------------------------------------------------
// Generated header of message definitions
// ---------------------------------------------------------------------------
static const char kHeaderFileName[] = "klpmsgd.h";
static const char kHeaderEnd[] = "#endif\n";

static void writeHeaderBanner(FILE* f) {
  char when[64];
  struct tm local;
  HSVTimeUTC now = hsvTimeGetUTC();
  if (!hsvTimeLocalTime(now.seconds, &local) || asctime_r(&local, when) == nullptr)
    strcpy(when, "(unknown)\n");
  fprintf(f,
          "//  This file is generated. Do not edit it.\n"
          "//\n"
          "//  It defines the msgLogger constants for klpMsgIds: one constant per message\n"
          "//  definition. The comment after each constant's value is the prepared message\n"
          "//  text, where\n"
          "//    @A  is the application name (ie: Capture)\n"
          "//    @S  is the program qualifier, aka schema (ie: KLP)\n"
          "//    ~1  represents the first value passed to putKlpMsg( ), it is not $1\n"
          "//    ~2  represents the second value passed, etc.\n"
          "//\n"
          "//  GenMsgHdr builds it from its input file or from its own internal message array.\n"
          "//  usage: GenMsgHdr  [-f klpmsgn.h]\n"
          "//\n"
          "//  This file was generated on %s"
          "//--------------------------------------------------\n"
          "#ifndef MSGDEFS_INCLUDED\n#define MSGDEFS_INCLUDED\n%s",
          when, kHeaderEnd);
  fflush(f);
}

void msgLogger::writeMsgHeader(logMsg* r) {
  if (r->doneMask & MSG_DEST_HEADER) return;
  r->doneMask |= MSG_DEST_HEADER;
  if (headerFile == nullptr) {
    headerFile = fopen(kHeaderFileName, "w+");
    if (headerFile == nullptr) {
      int err = errno;
      if (!headerOpenFailureReported) {
        logMsg* e = msgNewRecord(514, 0, r->origin, r->threadName);
        if (e != nullptr && e->text != nullptr) {
          char qt[MSG_QUALIFIER_MAX + MSG_THREAD_NAME_MAX + 8];
          qualifierAndThread(e->threadName, qt, sizeof qt);
          snprintf(e->text, static_cast<size_t>(e->textSize) + 1,
                   "KLP0514E \"%s\" : \"%s\" :  The program could not open the log file named "
                   "\"%s\", reason: \"%s\"",
                   getApplicationName(), qt, kHeaderFileName, strerror(err));
          e->severity = 'E';
          writeStderr(e);
        }
        msgFreeRecord(e);
        headerOpenFailureReported = 1;
      }
      writeStderr(r);
      return;
    }
    writeHeaderBanner(headerFile);
    // The record that opened the file gets its definition too: a banner
    // alone would lose the first message's constant.
  }
  if (r->sourceKind == MSG_SOURCE_NONE || r->text == nullptr) return;
  char prefix[48] = "";
  const char* comment = " // Catalog :  ";
  int constant = r->msgNumber;
  int value = r->msgNumber;
  if (r->sourceKind == MSG_SOURCE_EXTENSION) {
    comment = " // Extension: ";
  } else if (r->sourceKind == MSG_SOURCE_OVERRIDE) {
    snprintf(prefix, sizeof prefix, "#undef KlpMsg%04d\n  ", r->msgNumber);
    comment = " // Override:  ";
    value = r->internalNumber;
  }
  if (fseek(headerFile, -static_cast<long>(sizeof kHeaderEnd - 1), SEEK_END) != 0) return;
  fprintf(headerFile, "%s#define KlpMsg%04d  %4d%s%s\n%s", prefix, constant, value, comment,
          r->text, kHeaderEnd);
  fflush(headerFile);
  headerOpenFailureReported = 0;
}

// Closes the generated header so that a later use starts a new one.
void msgCloseMsgHeader() {
  if (headerFile != nullptr) fclose(headerFile);
  headerFile = nullptr;
  headerOpenFailureReported = 0;
}
