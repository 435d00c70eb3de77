#include "common/trace/trcformat.h"

#include <cinttypes>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <initializer_list>

#include "common/platform/hsv.h"
#include "common/trace/trace_anchor.h"
#include "common/trace/trcjson.h"
#include "common/trace/trcobjfmt.h"
#include "common/trace/trcprint.h"
#include "common/trace/trcread.h"
#include "common/trace/trcsymbols.h"

namespace {

// A character field of the version block; a NUL prints as a blank so that
// the text stays text.
char shown(char c) { return c != '\0' ? c : ' '; }

void printRelease(FILE* out, const klpReleaseBlock& r) {
  fprintf(out, "  %.*s %d.%d.%d\n", (int)sizeof r.programName, r.programName, r.version,
          r.release, r.modification);
  fprintf(out, "  Unique Name:       %.*s\n", (int)sizeof r.uniqueName, r.uniqueName);
  fprintf(out, "  Arch Level:        %.4s\n", r.archLevel);
  fprintf(out, "  Job Name(Orl):     %.*s\n", (int)sizeof r.jobName, r.jobName);
  fprintf(out, "  Program Apar(Orl): %.*s\n", (int)sizeof r.programFixLevel, r.programFixLevel);
  fprintf(out, "  RBASE   Apar(Orl): %.*s\n", (int)sizeof r.baseFixLevel, r.baseFixLevel);
}

// Thread name and id text of a record, remembered for the last thread seen:
// records of one thread come in runs.
struct ThreadNames {
  uint32_t tid = 0;
  bool valid = false;
  char idText[64];
  const trcThreadData* entry = nullptr;

  void put(FILE* out, uint32_t threadId) {
    if (!valid || threadId != tid) {
      tid = threadId;
      valid = true;
      trcThreadIdText(threadId, idText);
      entry = trcGetThreadData(threadId);
    }
    trcPutField(out, idText, sizeof idText);
    trcPuts(out, " thr = ");
    trcPutField(out, entry->threadName, sizeof entry->threadName);
  }
};

bool isExit(uint8_t type) { return type == TRC_REC_EXIT || type == TRC_REC_EXIT_VALUE; }

bool selected(const trcBlockHeader* h, const trcRecordHeader* r) {
  return (r->levelMask & trcFilterLevel(h, r->component, r->function)) != 0;
}

void putTimeOf(FILE* out, const trcRecordHeader* r) {
  trcPutTime(out, static_cast<int32_t>(r->time.seconds), r->time.microseconds);
}

// The return value of a type 4 record; nothing when it holds no object.
void putReturnValue(FILE* out, const trcRecordHeader* r) {
  uint32_t offset = 0;
  int index = 0;
  trcObject obj;
  if (trcNextObject(r, &offset, &index, &obj)) trcPutReturnValue(out, obj);
}

// The text of an entry or exit record after its function name: "fnc_entry
// at time ...", the plain exit text and the time, or "fnc_exit  at time ..."
// and the return value. False for a data record.
bool putCallEvent(FILE* out, const trcRecordHeader* r, const char* plainExit) {
  switch (r->type) {
    case TRC_REC_ENTRY: trcPuts(out, "fnc_entry at time "); break;
    case TRC_REC_EXIT: trcPuts(out, plainExit); break;
    case TRC_REC_EXIT_VALUE: trcPuts(out, "fnc_exit  at time "); break;
    default: return false;
  }
  putTimeOf(out, r);
  if (r->type == TRC_REC_EXIT_VALUE) {
    putc_unlocked(' ', out);
    putReturnValue(out, r);
  }
  return true;
}

// "fnc_data "name" "
void putDataName(FILE* out, const trcRecordHeader* r) {
  trcPuts(out, "fnc_data \"");
  trcPutField(out, r->name, sizeof r->name);
  trcPuts(out, "\" ");
}

void printThreadData(FILE* out, const trcBlockHeader* h) {
  trcPuts(out, "----------- Thread Specific Data Begin -----------\n");
  for (const trcThreadData* table : {h->threadTable, h->threadOverflow})
    for (int i = 0; i < TRC_THREAD_SLOTS; ++i) {
      const trcThreadData& e = table[i];
      if (e.key == TRC_FREE_KEY) continue;
      fprintf(out, "%.*s, THREAD NAME:%.*s\nDATA:%.*s\n", (int)sizeof e.threadIdText,
              e.threadIdText, (int)sizeof e.threadName, e.threadName, (int)sizeof e.data, e.data);
    }
  trcPuts(out, "----------- Thread Specific Data End -----------\n");
}

// Per-thread state of the flow style: parallel lists that grow by doubling.
struct FlowThreads {
  int32_t* pid = nullptr;
  uint32_t* tid = nullptr;
  int32_t* depth = nullptr;
  int32_t* minimum = nullptr;
  int count = 0, capacity = 0, last = 0;

  ~FlowThreads() {
    free(pid);
    free(tid);
    free(depth);
    free(minimum);
  }
  bool grow() {
    int cap = capacity == 0 ? 16 : capacity * 2;
    size_t n = static_cast<size_t>(cap);
    void* a = realloc(pid, n * sizeof *pid);
    if (a) pid = static_cast<int32_t*>(a);
    void* b = realloc(tid, n * sizeof *tid);
    if (b) tid = static_cast<uint32_t*>(b);
    void* c = realloc(depth, n * sizeof *depth);
    if (c) depth = static_cast<int32_t*>(c);
    void* d = realloc(minimum, n * sizeof *minimum);
    if (d) minimum = static_cast<int32_t*>(d);
    if (!a || !b || !c || !d) return false;
    capacity = cap;
    return true;
  }
  // Index of the pair, added when new; -1 without memory.
  int find(int32_t p, uint32_t t) {
    if (count > 0 && pid[last] == p && tid[last] == t) return last;
    for (int i = 0; i < count; ++i)
      if (pid[i] == p && tid[i] == t) return last = i;
    if (count == capacity && !grow()) return -1;
    pid[count] = p;
    tid[count] = t;
    depth[count] = 0;
    minimum[count] = INT32_MAX;
    return last = count++;
  }
};

// The depth bookkeeping of the first pass of flw and v7fmt: an exit lowers
// the depth before the minimum is taken, an entry raises it afterwards.
void noteDepth(const trcBlockHeader* h, const trcRecordHeader* r, int32_t* depth,
               int32_t* minimum) {
  if (isExit(r->type)) --*depth;
  if (selected(h, r) && *depth < *minimum) *minimum = *depth;
  if (r->type == TRC_REC_ENTRY) ++*depth;
}

}  // namespace

void trcPrintVersionInfo(FILE* out, const trcBlockHeader* h) {
  fprintf(out, "Trace Version: (platform: %.*s; format: %.*s; symbols: %.*s, %dx%d)\n",
          (int)sizeof h->platform, h->platform, (int)sizeof h->structVersion, h->structVersion,
          (int)sizeof h->symbolVersion, h->symbolVersion, h->componentCount,
          h->functionsPerComponent);
  printRelease(out, h->traceRelease);
  fputs("Application Version:\n", out);
  fputs("Replication version info:\n", out);
  const klpAppVersion& a = h->appVersion;
  printRelease(out, a.rel);
  fputs("Database version info:\n", out);
  fprintf(out, "  %.*s %d.%d.%d\n", (int)sizeof a.dbServerType, a.dbServerType, a.dbVersion,
          a.dbRelease, a.dbModification);
  fprintf(out, "  mode:              %c\n", shown(a.dbMode));
  fprintf(out, "  group attach name: %.*s\n", (int)sizeof a.dbGroupAttach, a.dbGroupAttach);
  fprintf(out, "  instance or group: %.*s\n", (int)sizeof a.dbInstance, a.dbInstance);
  fprintf(out, "  name:              %.*s\n", (int)sizeof a.dbName, a.dbName);
  fprintf(out, "  type:              %c\n", shown(a.dbType));
  fprintf(out, "  node name:         %.*s\n", (int)sizeof a.dbNodeName, a.dbNodeName);
  fprintf(out, "  auth id:           %.*s\n", (int)sizeof a.dbAuthId, a.dbAuthId);
  fprintf(out, "  server type:       %.*s\n", (int)sizeof a.dbServerType, a.dbServerType);
  fprintf(out, "  db platform:       %c\n", shown(a.dbPlatform));
  fprintf(out, "  appl code page:    %d\n", a.dbAppCodePage);
  fprintf(out, "  partition:         %d\n", a.dbPartition);
  fprintf(out, "  catalog partition: %d\n", a.dbCatalogPartition);
  fprintf(out, "  num partitions:    %d\n", a.dbNumPartitions);
  fprintf(out, "  server code page:  %d\n", a.dbServerCodePage);
  struct tm tm;
  char when[128];
  if (hsvTimeLocalTime(h->attachTime.seconds, &tm) &&
      strftime(when, sizeof when, "%a %b %d %Y %H:%M:%S %Z", &tm) != 0)
    fprintf(out, "Application attached at: %s\n", when);
  else
    fprintf(out, "Application attached at: %" PRId64 " seconds (no calendar time)\n",
            h->attachTime.seconds);
}

void trcFormatFull(FILE* out, const trcImage& image, bool hex) {
  const trcBlockHeader* h = image.header;
  ThreadNames names;
  trcIter it;
  trcIterInit(&it, h, image.size, image.fromFile);
  while (trcNextRecord(&it)) {
    const trcRecordHeader* r = it.record;
    if (!selected(h, r)) continue;
    trcPutNumber8(out, it.number);
    trcPuts(out, " pid = ");
    trcPutInt(out, r->pid);
    trcPuts(out, ", ");
    names.put(out, r->threadId);
    trcPuts(out, "\n         ");
    trcPuts(out, trcFunctionName(r->component, r->function));
    putc_unlocked(' ', out);
    if (putCallEvent(out, r, "fnc_exit at time ")) {
      putc_unlocked('\n', out);
    } else {
      putDataName(out, r);
      trcPuts(out, trcFullLevelText(r->levelMask));
      putc_unlocked('\n', out);
      uint32_t offset = 0;
      int index = 0;
      trcObject obj;
      while (trcNextObject(r, &offset, &index, &obj)) {
        trcPuts(out, "         Object ");
        trcPutInt(out, obj.number);
        trcPuts(out, " of type \"");
        trcPuts(out, trcObjectTypeName(obj.type));
        trcPuts(out, "\": ");
        trcFormatObject(out, obj.type, obj.length, obj.data, hex);
      }
    }
    putc_unlocked('\n', out);
  }
}

void trcFormatFlow(FILE* out, const trcImage& image) {
  const trcBlockHeader* h = image.header;
  FlowThreads threads;
  trcIter it;
  trcIterInit(&it, h, image.size, image.fromFile);
  while (trcNextRecord(&it)) {
    const trcRecordHeader* r = it.record;
    int t = threads.find(r->pid, r->threadId);
    if (t < 0) {
      trcIterEnd(&it);
      trcPuts(out, "out of memory.\n");
      return;
    }
    noteDepth(h, r, &threads.depth[t], &threads.minimum[t]);
  }
  ThreadNames names;
  for (int t = 0; t < threads.count; ++t) {
    if (threads.minimum[t] == INT32_MAX) continue;
    trcPuts(out, "pid = ");
    trcPutInt(out, threads.pid[t]);
    trcPuts(out, ", ");
    names.put(out, threads.tid[t]);
    putc_unlocked('\n', out);
    int64_t depth = -static_cast<int64_t>(threads.minimum[t]);
    trcIterInit(&it, h, image.size, image.fromFile);
    while (trcNextRecord(&it)) {
      const trcRecordHeader* r = it.record;
      if (r->pid != threads.pid[t] || r->threadId != threads.tid[t]) continue;
      int64_t indent = depth;
      if (r->type == TRC_REC_ENTRY) ++depth;
      else if (isExit(r->type)) indent = --depth;
      if (!selected(h, r)) continue;
      trcPutNumber8(out, it.number);
      putc_unlocked(' ', out);
      for (int64_t i = 0; i < indent; ++i) trcPutn(out, "| ", 2);
      trcPuts(out, trcFunctionName(r->component, r->function));
      putc_unlocked(' ', out);
      if (!putCallEvent(out, r, "fnc_exit  at time ")) {
        putDataName(out, r);
        trcPuts(out, trcFlowLevelText(r->levelMask));
        uint32_t offset = 0;
        int index = 0;
        trcObject obj;
        if ((r->levelMask & TRC_LVL_PERF) && trcNextObject(r, &offset, &index, &obj) &&
            obj.type == TRC_OBJ_TIMESTAMP && obj.length >= sizeof(trcTimeValue)) {
          trcTimeValue tv;
          memcpy(&tv, obj.data, sizeof tv);
          trcPuts(out, " at time ");
          trcPutTime(out, static_cast<int32_t>(tv.seconds), tv.microseconds);
        }
      }
      putc_unlocked('\n', out);
    }
    putc_unlocked('\n', out);
  }
}

void trcFormatV7(FILE* out, const trcImage& image) {
  const trcBlockHeader* h = image.header;
  int32_t depth = 0, minimum = INT32_MAX;
  trcIter it;
  trcIterInit(&it, h, image.size, image.fromFile);
  while (trcNextRecord(&it)) noteDepth(h, it.record, &depth, &minimum);
  int64_t level = minimum == INT32_MAX ? 0 : -static_cast<int64_t>(minimum);
  trcIterInit(&it, h, image.size, image.fromFile);
  while (trcNextRecord(&it)) {
    const trcRecordHeader* r = it.record;
    if (r->type == TRC_REC_ENTRY) ++level;
    else if (isExit(r->type)) --level;
    if (r->type != TRC_REC_DATA || !selected(h, r)) continue;
    for (int64_t i = 0; i < level; ++i) putc_unlocked(' ', out);
    uint32_t offset = 0;
    int index = 0;
    trcObject obj;
    if (trcNextObject(r, &offset, &index, &obj) &&
        (obj.type == TRC_OBJ_STRING || obj.type == TRC_OBJ_TRCSTRING)) {
      trcPutField(out, reinterpret_cast<const char*>(obj.data), obj.length);
    } else {
      trcPutField(out, r->name, sizeof r->name);
    }
    putc_unlocked('\n', out);
  }
}

void trcFormatStyles(FILE* out, const trcImage& image, bool flw, bool fmt, bool v7fmt, bool hex) {
  if (!trcThreadTablesInUse()) trcLoadThreadTables(image.header);
  flockfile(out);
  trcPrintVersionInfo(out, image.header);
  printThreadData(out, image.header);
  if (flw) trcFormatFlow(out, image);
  if (fmt) trcFormatFull(out, image, hex);
  if (v7fmt) trcFormatV7(out, image);
  funlockfile(out);
  fflush(out);
}

// ---------------------------------------------------------------------------
// Obtaining the image
// ---------------------------------------------------------------------------

namespace {

// The filter words between the global filter and the application flag.
constexpr size_t kFilterWordsOffset = offsetof(trcBlockHeader, componentFilters);
constexpr size_t kFilterWordsSize = offsetof(trcBlockHeader, appAttached) - kFilterWordsOffset;

void setFormatFilters(trcBlockHeader* h, const trcOptions* o) {
  h->globalFilter = o->outLevel;
  memset(reinterpret_cast<uint8_t*>(h) + kFilterWordsOffset, 0, kFilterWordsSize);
  trcApplyFilters(h, o->filters, o->filterCount);
}

bool obtainFromFile(const trcOptions* o, trcSource* src) {
  trcBlockHeader* h = static_cast<trcBlockHeader*>(malloc(sizeof(trcBlockHeader)));
  if (h == nullptr) {
    printf("Unable to allocate storage for local copy of trace control block for formatting "
           "from file \"%s\".\n", o->fileName);
    return false;
  }
  src->image = trcImage{h, sizeof *h, true};
  src->owned = true;
  if (src->live != nullptr) {
    trcLockFile(src->live);
    src->fileLocked = true;
  }
  FILE* out = trcOut();
  int rc = trcReadFileHeader(o->fileName, h);
  if (rc != TRC_READ_OK) {
    fprintf(out, rc == TRC_READ_NO_FILE ? "Unable to open file \"%s\".\n"
                                        : "Unable to read header from file \"%s\".\n",
            o->fileName);
    return false;
  }
  // The records are read from the file given, whatever name it was written
  // under: a trace file may have been moved or copied since.
  memset(h->fileName, 0, sizeof h->fileName);
  strncpy(h->fileName, o->fileName, sizeof h->fileName - 1);
  return trcCheckVersion(h, o->fileName, true);
}

bool obtainFromBuffer(const trcOptions* o, trcSource* src) {
  trcAnchor* anchor = trcGetAnchor();
  if (src->live == nullptr) {
    fputs("Trace is not turned on.\n", trcOut());
    return false;
  }
  size_t size = anchor->memory->getSize();
  trcBlockHeader* copy = static_cast<trcBlockHeader*>(malloc(size));
  if (copy == nullptr) {
    if (!o->holdlock) {
      printf("Unable to obtain memory to copy buffer for formatting.\n"
             "Either make more memory available or use the '-holdlock' option\n"
             "(this will impact the performance of the running application.)\n");
      return false;
    }
    src->savedFilters = static_cast<uint8_t*>(malloc(kFilterWordsSize + sizeof(uint16_t)));
    if (src->savedFilters == nullptr) {
      printf("Unable to obtain memory to copy buffer for formatting.\n");
      return false;
    }
    trcLockBuffer(src->live);
    src->holding = true;
    memcpy(src->savedFilters, &src->live->globalFilter, sizeof(uint16_t));
    memcpy(src->savedFilters + sizeof(uint16_t),
           reinterpret_cast<uint8_t*>(src->live) + kFilterWordsOffset, kFilterWordsSize);
    src->image = trcImage{src->live, size, false};
    return true;
  }
  trcLockBuffer(src->live);
  memcpy(copy, src->live, size);
  trcUnlockBuffer(src->live);
  // The copy's lock bytes are those of the moment of copying: clear them so
  // that nothing reading the copy mistakes them for held locks.
  copy->bufferLock = copy->fileLock = 0;
  src->image = trcImage{copy, size, false};
  src->owned = true;
  return true;
}

}  // namespace

bool trcObtainImage(const trcOptions* o, trcSource* src) {
  memset(src, 0, sizeof *src);
  trcAnchor* anchor = trcGetAnchor();
  src->live = anchor != nullptr ? anchor->block : nullptr;
  bool ok = o->fileName != nullptr ? obtainFromFile(o, src) : obtainFromBuffer(o, src);
  if (ok) setFormatFilters(src->image.header, o);
  return ok;
}

void trcReleaseImage(trcSource* src) {
  if (src->fileLocked) trcUnlockFile(src->live);
  if (src->holding) {
    memcpy(&src->live->globalFilter, src->savedFilters, sizeof(uint16_t));
    memcpy(reinterpret_cast<uint8_t*>(src->live) + kFilterWordsOffset,
           src->savedFilters + sizeof(uint16_t), kFilterWordsSize);
    trcUnlockBuffer(src->live);
  }
  free(src->savedFilters);
  if (src->owned) free(src->image.header);
  memset(src, 0, sizeof *src);
}

void trcFormatCommand(const trcOptions* o) {
  trcSource src;
  if (trcObtainImage(o, &src)) {
    if (o->json)
      trcFormatJson(trcOut(), src.image);
    else
      trcFormatStyles(trcOut(), src.image, o->flw, o->fmt, o->v7fmt, o->hex);
  }
  trcReleaseImage(&src);
}
