#include "common/trace/trcjson.h"

#include <cinttypes>
#include <cstdlib>
#include <cstring>
#include <vector>

#include "common/trace/trace_anchor.h"
#include "common/trace/trcobjfmt.h"
#include "common/trace/trcprint.h"
#include "common/trace/trcread.h"
#include "common/trace/trcsymbols.h"

namespace {

// Length of the UTF-8 sequence at s (at most n bytes), or 0 when it is not
// a well-formed one.
size_t utf8Length(const unsigned char* s, size_t n) {
  unsigned char c = s[0];
  size_t len = c >= 0xF0 && c <= 0xF4 ? 4 : c >= 0xE0 ? 3 : c >= 0xC2 && c < 0xE0 ? 2 : 0;
  if (len == 0 || len > n) return 0;
  for (size_t i = 1; i < len; ++i)
    if ((s[i] & 0xC0) != 0x80) return 0;
  if (len == 3 && ((c == 0xE0 && s[1] < 0xA0) || (c == 0xED && s[1] >= 0xA0))) return 0;
  if (len == 4 && ((c == 0xF0 && s[1] < 0x90) || (c == 0xF4 && s[1] >= 0x90))) return 0;
  return len;
}

// A JSON string of n bytes: quotes, backslashes and control characters
// escaped; bytes that are not UTF-8 are taken as Latin-1, so the output is
// always valid JSON.
void putJsonString(FILE* out, const char* text, size_t n) {
  const unsigned char* s = reinterpret_cast<const unsigned char*>(text);
  putc_unlocked('"', out);
  for (size_t i = 0; i < n;) {
    unsigned char c = s[i];
    if (c == '"' || c == '\\') {
      putc_unlocked('\\', out);
      putc_unlocked(static_cast<char>(c), out);
      ++i;
    } else if (c == '\n') {
      trcPutn(out, "\\n", 2);
      ++i;
    } else if (c < 0x20 || c == 0x7F) {
      fprintf(out, "\\u%04x", c);
      ++i;
    } else if (c < 0x80) {
      putc_unlocked(static_cast<char>(c), out);
      ++i;
    } else if (size_t len = utf8Length(s + i, n - i)) {
      trcPutn(out, text + i, len);
      i += len;
    } else {
      fprintf(out, "\\u%04x", c);
      ++i;
    }
  }
  putc_unlocked('"', out);
}
void putJsonField(FILE* out, const char* s, size_t max) { putJsonString(out, s, strnlen(s, max)); }
void putJsonText(FILE* out, const char* s) { putJsonString(out, s, strlen(s)); }

struct Thread {
  int32_t pid;
  uint32_t tid;
  int64_t depth;
};

// Threads seen so far; each is named by a metadata event when first seen.
struct Threads {
  std::vector<Thread> list;
  size_t last = 0;
  Thread* find(FILE* out, bool* first, int32_t pid, uint32_t tid) {
    if (last < list.size() && list[last].pid == pid && list[last].tid == tid) return &list[last];
    for (size_t i = 0; i < list.size(); ++i)
      if (list[i].pid == pid && list[i].tid == tid) return &list[last = i];
    list.push_back(Thread{pid, tid, 0});
    last = list.size() - 1;
    const trcThreadData* e = trcGetThreadData(tid);
    fprintf(out, "%s{\"name\":\"thread_name\",\"ph\":\"M\",\"pid\":%d,\"tid\":%u,\"args\":{\"name\":",
            *first ? "\n" : ",\n", pid, tid);
    putJsonField(out, e->threadName, sizeof e->threadName);
    fputs("}}", out);
    *first = false;
    return &list[last];
  }
};

// Microseconds since the epoch of a record's time value (seconds kept
// within a range whose microseconds fit a JSON number exactly).
int64_t micros(const trcTimeValue& t) {
  int64_t s = t.seconds;
  if (s > 9000000000LL) s = 9000000000LL;
  if (s < -9000000000LL) s = -9000000000LL;
  return s * 1000000 + t.microseconds;
}

// Text of one object as fmt prints it, less its layout: the data lines'
// indentation and the surrounding line feeds.
struct ObjectText {
  char* buf = nullptr;
  size_t size = 0;
  FILE* mem = open_memstream(&buf, &size);
  ~ObjectText() {
    if (mem) fclose(mem);
    free(buf);
  }
  // The stream to write the text into, emptied.
  FILE* begin() {
    if (mem != nullptr) fseek(mem, 0, SEEK_SET);
    return mem;
  }
  // Writes what was written since begin as a JSON string.
  void end(FILE* out) {
    if (mem == nullptr) return putJsonText(out, "");
    fflush(mem);
    size_t n = static_cast<size_t>(ftell(mem));
    size_t w = 0;
    for (size_t i = 0; i < n; ++i) {
      if (buf[i] == '\n' && i + 10 <= n && memcmp(buf + i + 1, "         ", 9) == 0) {
        buf[w++] = '\n';
        i += 9;
      } else {
        buf[w++] = buf[i];
      }
    }
    size_t start = 0;
    while (start < w && buf[start] == '\n') ++start;
    while (w > start && buf[w - 1] == '\n') --w;
    putJsonString(out, buf + start, w - start);
  }
  void object(FILE* out, const trcObject& obj) {
    if (FILE* m = begin()) trcFormatObject(m, obj.type, obj.length, obj.data, false);
    end(out);
  }
};

}  // namespace

void trcFormatJson(FILE* out, const trcImage& image) {
  const trcBlockHeader* h = image.header;
  if (!trcThreadTablesInUse()) trcLoadThreadTables(h);
  // Data records carry a name in place of a time: they are placed at the
  // time of the record before them, and those before any timed record at
  // the first time of the trace.
  int64_t now = 0;
  trcIter it;
  trcIterInit(&it, h, image.size, image.fromFile);
  while (trcNextRecord(&it)) {
    if (it.record->type != TRC_REC_DATA) {
      now = micros(it.record->time);
      trcIterEnd(&it);
      break;
    }
  }
  flockfile(out);
  fputs("{\"displayTimeUnit\":\"ms\",\"traceEvents\":[", out);
  bool first = true;
  Threads threads;
  ObjectText text;
  trcIterInit(&it, h, image.size, image.fromFile);
  while (trcNextRecord(&it)) {
    const trcRecordHeader* r = it.record;
    if (r->type != TRC_REC_DATA) now = micros(r->time);
    if ((r->levelMask & trcFilterLevel(h, r->component, r->function)) == 0) continue;
    Thread* t = threads.find(out, &first, r->pid, r->threadId);
    const char* phase = "i";
    if (r->type == TRC_REC_ENTRY) {
      phase = "B";
      ++t->depth;
    } else if (r->type == TRC_REC_EXIT || r->type == TRC_REC_EXIT_VALUE) {
      // An exit whose entry was overwritten before the trace was taken has
      // nothing to close.
      if (t->depth == 0) continue;
      phase = "E";
      --t->depth;
    }
    const char* component = trcComponentName(r->component);
    fputs(",\n{\"name\":", out);
    if (r->type == TRC_REC_ENTRY || phase[0] == 'E')
      putJsonText(out, trcFunctionName(r->component, r->function));
    else
      putJsonField(out, r->name, sizeof r->name);
    fputs(",\"cat\":", out);
    putJsonText(out, component != nullptr ? component : "UNKNOWN COMPONENT");
    fprintf(out, ",\"ph\":\"%s\",\"ts\":%" PRId64 ",\"pid\":%d,\"tid\":%u", phase, now, r->pid,
            r->threadId);
    uint32_t offset = 0;
    int index = 0;
    trcObject obj;
    if (r->type == TRC_REC_EXIT_VALUE) {
      if (trcNextObject(r, &offset, &index, &obj)) {
        fputs(",\"args\":{\"return\":", out);
        if (FILE* m = text.begin()) trcPutReturnValue(m, obj);
        text.end(out);
        fputs("}", out);
      }
    } else if (phase[0] == 'i') {
      fputs(",\"s\":\"t\",\"args\":{\"function\":", out);
      putJsonText(out, trcFunctionName(r->component, r->function));
      fputs(",\"level\":", out);
      putJsonText(out, trcFullLevelText(r->levelMask));
      while (trcNextObject(r, &offset, &index, &obj)) {
        char key[96];
        snprintf(key, sizeof key, "%d %s", obj.number, trcObjectTypeName(obj.type));
        putc_unlocked(',', out);
        putJsonText(out, key);
        putc_unlocked(':', out);
        text.object(out, obj);
      }
      fputs("}", out);
    }
    fputs("}", out);
  }
  fputs("\n]}\n", out);
  funlockfile(out);
  fflush(out);
}
