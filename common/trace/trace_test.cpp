// Trace writer and reader: damaged images, what is kept, attaching, the command short of memory.
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "common/trace/trace.h"
#include "common/trace/trace_anchor.h"
#include "common/trace/trcread.h"
#include "common/trace/trcsymbols.h"
#include "common/trace/trcwrite.h"
#include "common/util/klpfmt.h"
#include "include/klptrc.h"
#include "tests/testing/klptest.h"

// Short of memory, malloc answers null here as it does without the sanitizer.
extern "C" const char* __asan_default_options() { return "allocator_may_return_null=1"; }

namespace {

using klptest::stdoutOf;
constexpr uint32_t kArea = TRC_MIN_SIZE - TRC_HEADER_SIZE;  // 35808 bytes of records
const char* const kKey = "TDB.KLP.KCAP";

struct Rec {
  int type, component, function, level;
  uint32_t threadId;
  int32_t pid;
  std::string name;
  std::vector<std::pair<int, std::string>> objects;  // type, data bytes
  int value() const { int v; memcpy(&v, objects.at(0).second.data(), sizeof v); return v; }
};

struct Walk {
  std::vector<Rec> records;
  int error = -1;
  std::string said;  // what the reader printed
};

Walk walk(const trcBlockHeader* h, size_t size, bool fromFile) {
  Walk w;
  w.said = stdoutOf([&] {
    trcIter it;
    trcIterInit(&it, h, size, fromFile);
    while (trcNextRecord(&it)) {
      const trcRecordHeader* r = it.record;
      Rec rec{r->type, r->component, r->function, r->levelMask, r->threadId, r->pid,
              std::string(r->name, 16), {}};
      uint32_t off = 0;
      int index = 0;
      trcObject o;
      while (trcNextObject(r, &off, &index, &o))
        rec.objects.push_back({o.type, std::string(reinterpret_cast<const char*>(o.data), o.length)});
      w.records.push_back(rec);
    }
    w.error = it.error;
  });
  return w;
}

Walk walkFile(const std::string& path) {
  trcBlockHeader h;
  if (trcReadFileHeader(path.c_str(), &h) != TRC_READ_OK) return Walk{};
  return walk(&h, 0, true);
}

void save(const std::string& path, const std::string& bytes) {
  std::ofstream(path, std::ios::binary) << bytes;
}

// A trace block of this process, made as the trace command does from the anchor's keys.
struct Trace {
  klptest::TmpDir dir;
  explicit Trace(uint32_t size = TRC_MIN_SIZE, const std::string& file = "",
                 uint32_t fileSize = TRC_MAX_SIZE) {
    trcInitAnchor();
    trcAnchor* a = trcGetAnchor();
    snprintf(a->keyPart1, TRC_KEY_SIZE, "%s", dir.path().c_str());
    snprintf(a->keyPart2, TRC_KEY_SIZE, "%s", kKey);
    EXPECT_EQ(0, trcCreate(size, a->keyPart1, a->keyPart2, file.empty() ? nullptr : file.c_str(),
                           fileSize, 0x3F, true));
  }
  ~Trace() {
    trcFree();
    EXPECT_FALSE(klptest::memoryExists(dir.path() + kKey + ".TRC"));
  }
  trcBlockHeader* b() const { return trcGetAnchor()->block; }
  Walk read() const { return walk(b(), b()->bufferSize, false); }
};

void put(int v) { trcData(5, 7, "value", TRC_LVL_BASIC, TRC_OBJ_SIGNED, 4, &v); }

// A hand-made image: header and data area, records placed by offset.
struct Image {
  std::string bytes = std::string(TRC_MIN_SIZE, '\0');
  trcBlockHeader* h() { return reinterpret_cast<trcBlockHeader*>(bytes.data()); }
  Image(uint32_t write, uint32_t oldest, uint32_t high, uint32_t count, uint32_t data = TRC_HEADER_SIZE) {
    h()->dataOffset = data;
    h()->writeOffset = write;
    h()->oldestOffset = oldest;
    h()->highWaterOffset = high;
    h()->entryCount = count;
    h()->bufferSize = TRC_MIN_SIZE;
    h()->maxFileSize = TRC_MAX_SIZE;
    strcpy(h()->platform, "Linux");
    strcpy(h()->structVersion, "0012");
  }
  Image& rec(uint32_t off, uint32_t length, uint16_t function = 1, uint16_t objects = 0,
             uint16_t objectLength = 0) {
    trcRecordHeader r{};
    r.length = length;
    r.function = function;
    r.objectCount = objects;
    r.type = TRC_REC_DATA;
    memcpy(&bytes[TRC_HEADER_SIZE + off], &r, sizeof r);
    trcObjectHeader o{TRC_OBJ_RAW, objectLength};
    memcpy(&bytes[TRC_HEADER_SIZE + off + 40], &o, sizeof o);
    return *this;
  }
};

TEST(TraceReader, DamagedImagesEndTheWalkWithAMessage) {
  struct Row {
    const char* what;
    Image image;
    size_t records;
    int error, fileError;
    const char* said;
    size_t fileBytes = 0;  // the file cut after these many bytes of records
  };
  const int OK = TRC_WALK_OK, HEADER = TRC_WALK_BAD_HEADER, RECORD = TRC_WALK_BAD_RECORD;
  std::vector<Row> rows = {
      {"length below 40", Image(80, 0, 80, 1).rec(0, 36), 0, RECORD, RECORD, "impossible length 36"},
      {"length not 4-aligned", Image(80, 0, 80, 1).rec(0, 42), 0, RECORD, RECORD, "impossible length 42"},
      {"length 0 never loops", Image(80, 0, 80, 2).rec(0, 0), 0, RECORD, RECORD, "impossible length 0"},
      {"length past high water", Image(40, 0, 40, 1).rec(0, 80), 0, RECORD, RECORD, "impossible length 80"},
      {"entry count above the records held", Image(160, 0, 160, 3).rec(0, 80).rec(80, 80), 2,
       TRC_WALK_SHORT, TRC_WALK_SHORT, "counts 3 records but only 2"},
      {"data area inside the header", Image(40, 0, 40, 1, 95260), 0, HEADER, HEADER, "data-area offset"},
      {"offsets not multiples of 4", Image(42, 0, 42, 1), 0, HEADER, HEADER, "multiples of 4"},
      {"oldest past high water", Image(40, 80, 40, 1), 0, HEADER, HEADER, "beyond the high-water"},
      {"more entries than bytes", Image(40, 0, 40, 2).rec(0, 40), 0, HEADER, HEADER, "more entries"},
      {"high-water offset beyond the buffer", Image(kArea + 40, 0, kArea + 40, 1), 0, HEADER, RECORD, ""},
      {"object runs past its record", Image(48, 0, 48, 1).rec(0, 48, 1, 1, 20), 1, OK, OK,
       "Object 1 of length 20 runs past"},
      {"more objects than fit", Image(48, 0, 48, 1).rec(0, 48, 1, 2, 4), 1, OK, OK, "Object 2 lies beyond"},
      {"wrapped", Image(40, 80, 120, 2).rec(0, 40, 2).rec(40, 40, 9).rec(80, 40, 1), 2, OK, OK, ""},
      {"stale bytes past the write offset", Image(40, 0, 120, 1).rec(0, 40).rec(40, 40), 1, OK, OK, ""},
      // Files claiming more than they hold: refused before memory is sized by them.
      {"2 GB counters and length over 48 bytes",
       Image(0x7FFFFFF0, 0, 0x7FFFFFF0, 1).rec(0, 0x7FFFFFF0), 0, HEADER, RECORD, "", 48},
      {"file cut after the record header", Image(80, 0, 80, 1).rec(0, 80), 1, OK, RECORD, "", 40},
      {"file cut inside the record header", Image(80, 0, 80, 1).rec(0, 80), 1, OK, TRC_WALK_IO, "", 20},
  };
  klptest::TmpDir dir;
  for (Row& row : rows) {
    SCOPED_TRACE(row.what);
    Walk mem = walk(row.image.h(), row.image.bytes.size(), false);
    EXPECT_EQ(row.records, mem.records.size());
    EXPECT_EQ(row.error, mem.error);
    EXPECT_NE(std::string::npos, mem.said.find(row.said)) << mem.said;
    if (row.error == OK && row.records == 2) {
      EXPECT_EQ(1, mem.records[0].function);  // the oldest first
      EXPECT_EQ(2, mem.records[1].function);
    }
    // The same bytes as a trace file.
    std::string path = dir.path() + "image.trc";
    snprintf(row.image.h()->fileName, TRC_KEY_SIZE, "%s", path.c_str());
    save(path, row.fileBytes ? row.image.bytes.substr(0, TRC_HEADER_SIZE + row.fileBytes)
                             : row.image.bytes);
    Walk file = walkFile(path);
    EXPECT_EQ(row.fileError, file.error);
    bool whole = row.fileError == OK || row.fileError == TRC_WALK_SHORT;
    EXPECT_EQ(whole ? row.records : 0u, file.records.size());
  }
}

TEST(TraceWriter, WhatARecordHolds) {
  struct Row {
    const char* what;
    std::function<void(trcBlockHeader*)> setup;
    std::function<uint32_t()> point;
    uint32_t level;
    int records, type;
    std::vector<std::pair<int, std::string>> objects;
    const char* name;
    const char* function = nullptr;  // the symbol row the first record names
  };
  const int str = TRC_OBJ_STRING, exitValue = TRC_REC_EXIT_VALUE;
  auto none = [](trcBlockHeader*) {};
  auto x = [] { return trcData(5, 7, "x", 2, TRC_OBJ_STRING, 1, "x"); };
  std::string big(kArea - 44, 'x');
  std::vector<Row> rows = {
      {"null pointer keeps its declared type", none,
       [] { return trcData(5, 7, "nothing", 2, str, 10, nullptr); }, 0x3F, 1, TRC_REC_DATA,
       {{TRC_OBJ_NULL, std::string("\3\0", 2)}}, "nothing        "},
      {"name cut to 15", none,
       [] { return trcData(5, 7, "a name much too long", 2, str, 2, "ab"); }, 0x3F, 1,
       TRC_REC_DATA, {{str, "ab"}}, "a name much too"},
      {"component 54 records nothing", none, [] { return trcEntry(54, 1); }, 0, 0, 0, {}, ""},
      {"function 250 records nothing", none, [] { return trcEntry(5, 250); }, 0, 0, 0, {}, ""},
      {"function override of no levels", [](trcBlockHeader* b) { b->functionFilters[5][7] = 0x8000; },
       x, 0, 0, 0, {}, ""},
      {"component override of level 2: no entry record",
       [](trcBlockHeader* b) { b->componentFilters[5] = 0x8002; },
       [] { return trcEntry(5, 7); }, 2, 0, 0, {}, ""},
      {"exit with a return code", none, [] { trcExit(5, 7, TRC_RET_RC, 12); return 1u; }, 1, 1,
       exitValue, {{TRC_OBJ_RC, std::string("\14\0", 2)}}, nullptr},
      {"exit with a boolean", none, [] { trcExit(5, 7, TRC_RET_BOOL, 0, 1); return 1u; }, 1, 1,
       exitValue, {{TRC_OBJ_BOOL, std::string("\1\0\0\0", 4)}}, nullptr},
      {"exit with a pointer", none, [] { trcExit(5, 7, TRC_RET_PTR, 0, 0, 0x0102); return 1u; }, 1,
       1, exitValue, {{TRC_OBJ_POINTER, std::string("\2\1\0\0\0\0\0\0", 8)}}, nullptr},
      {"exit of another kind has no object", none,
       [] { trcExit(5, 7, 9, 12); return 1u; }, 1, 1, TRC_REC_EXIT, {}, nullptr},
      {"damaged area: start afresh", [](trcBlockHeader* b) { b->highWaterOffset = kArea, b->entryCount = 5; },
       x, 0x3F, 1, TRC_REC_DATA, {{str, "x"}}, "x              "},
      {"a stopped block takes nothing", [](trcBlockHeader* b) { b->status = TRC_STATE_STOP; },
       [] { return trcEntry(5, 7); }, 0x3F, 0, 0, {}, ""},
      {"a record as large as the data area fits an empty buffer", none,
       [&] { return trcData(5, 7, "big", 2, TRC_OBJ_RAW, kArea - 44, big.data()); }, 0x3F, 1,
       TRC_REC_DATA, {{TRC_OBJ_RAW, big}}, "big            "},
      {"a library routine's points name its own row", none,
       [] { return static_cast<uint32_t>(compareIgnTransCriteria("A%C", "ABBC")); }, 1, 2,
       TRC_REC_ENTRY, {}, nullptr, "compareIgnTransCriteria"},
      {"the common body takes 32 objects of 33", none,
       [] {
         int types[33];
         uint32_t lengths[33];
         const void* pointers[33];
         for (int i = 0; i < 33; ++i) types[i] = str, lengths[i] = 1, pointers[i] = "z";
         return trcDataN(5, 7, "many", 2, 33, types, lengths, pointers);
       }, 0x3F, 1, TRC_REC_DATA, std::vector<std::pair<int, std::string>>(32, {str, "z"}), "many           "},
      {"one byte more is never written", none,
       [&] { return trcData(5, 7, "big", 2, TRC_OBJ_RAW, kArea - 43, big.data()); }, 0x3F, 0, 0, {}, ""},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.what);
    Trace t;
    row.setup(t.b());
    EXPECT_EQ(row.level, row.point());
    t.b()->status = TRC_STATE_RUNNING;
    Walk w = t.read();
    EXPECT_EQ("", w.said);  // a sound record draws no complaint
    ASSERT_EQ(static_cast<size_t>(row.records), w.records.size());
    if (row.records == 0) continue;
    const Rec& r = w.records[0];
    EXPECT_EQ(row.type, r.type);
    EXPECT_EQ(row.objects, r.objects);
    EXPECT_EQ(hsvProcessID(), r.pid);
    if (row.name != nullptr) { EXPECT_EQ(std::string(row.name) + '\0', r.name); }
    if (row.function != nullptr) { EXPECT_STREQ(row.function, trcFunctionName(r.component, r.function)); }
  }
  Trace t;  // a routine's exit record carries the code it answers
  ASSERT_EQ(1, compareIgnTransCriteria("A%C", "ABBC"));
  Walk w = t.read();
  ASSERT_EQ(2u, w.records.size());
  EXPECT_EQ((std::vector<std::pair<int, std::string>>{{TRC_OBJ_RC, std::string("\1\0", 2)}}), w.records[1].objects);
}

TEST(TraceWriter, WrapKeepsTheNewestRecords) {
  Trace t;
  for (int v = 0; v < 2000; ++v) put(v);
  Walk w = t.read();
  // 48-byte records: 746 fill the 35808-byte area exactly.
  ASSERT_EQ(746u, w.records.size());
  EXPECT_EQ(TRC_WALK_OK, w.error);
  for (size_t i = 0; i < w.records.size(); ++i) EXPECT_EQ(1254 + static_cast<int>(i), w.records[i].value());
}

TEST(TraceWriter, DirectToFileLosesNothingUntilItsLimit) {
  // Laps of 746 records (35808 bytes): three fit 131072, the last one not the 23648 bytes left.
  struct Row {
    uint32_t fileSize;
    int written, kept;
    bool said;  // the file was reported full (once)
  };
  for (const Row& row : std::vector<Row>{{TRC_MAX_SIZE, 5000, 5000, false},
                                         {TRC_MIN_SIZE, 4230, 2238, true},
                                         {TRC_MIN_SIZE, 3830, 2238, true}}) {
    SCOPED_TRACE(row.written);
    klptest::TmpDir files;
    std::string path = files.path() + "direct.trc";
    {
      Trace t(TRC_MIN_SIZE, path, row.fileSize);
      std::string said = stdoutOf([&] {
        for (int v = 0; v < row.written; ++v) put(v);
        trcFlushLastLap(t.b());
      });
      EXPECT_EQ(row.said ? "Trace file \"" + path + "\" has reached its maximum size of 131072 "
                           "bytes, no more records are written to it.\n"
                         : "",
                said);
    }
    Walk w = walkFile(path);
    ASSERT_EQ(static_cast<size_t>(row.kept), w.records.size());
    for (int i = 0; i < row.kept; ++i) ASSERT_EQ(i, w.records[i].value());
  }
}

TEST(TraceWriter, RecordsFromTwoThreads) {
  Trace t;
  uint32_t tids[2];
  auto writer = [&](int k) {
    tids[k] = static_cast<uint32_t>(hsvThreadID());
    for (int i = 0; i < 300; ++i) put(1000 * k + i);
  };
  std::thread a(writer, 0), b(writer, 1);
  a.join();
  b.join();
  int next[2] = {0, 1000};
  for (const Rec& r : t.read().records) {
    int k = r.threadId == tids[0] ? 0 : 1;
    ASSERT_EQ(tids[k], r.threadId);
    EXPECT_EQ(next[k]++, r.value());
  }
  EXPECT_EQ(300, next[0]);
  EXPECT_EQ(1300, next[1]);
}

// The block is unmapped only once a writing thread is out of it.
TEST(TraceWriter, DetachWhileAnotherThreadWrites) {
  Trace t;
  std::atomic<bool> done{false};
  std::thread writer([&] {
    for (int v = 0; !done; ++v) put(v);
  });
  for (int i = 0; i < 200; ++i) {
    trcDetach();
    ASSERT_EQ(0, trcAttach(t.dir.path().c_str(), kKey, nullptr, nullptr));
  }
  done = true;
  writer.join();
  EXPECT_EQ(TRC_WALK_OK, t.read().error);
}

TEST(TraceFile, FlushFaults) {
  struct Row {
    const char* what;
    std::string existing;  // the file's bytes before the flush ("" none)
    int entries, stale;    // records in the image, and stale ones after its write offset
    bool ok;
    size_t records;        // in the file afterwards
    const char* said;      // %s: the file's path
    const char* file = "f.trc";
  };
  auto header = [](const char* platform, uint32_t dataOffset) {
    Image i(0, 0, 0, 0, dataOffset);
    strcpy(i.h()->platform, platform);
    return i.bytes.substr(0, TRC_HEADER_SIZE);
  };
  std::vector<Row> rows = {
      {"a header cut short is written afresh", "short", 3, 0, true, 3, ""},
      {"another platform's file is refused", header("Windows", TRC_HEADER_SIZE), 3, 0, false, 0,
       "File %s was generated by an incompatible Trace version."},
      {"a damaged header is refused", header("Linux", 8), 3, 0, false, 0, "is damaged"},
      {"an empty image appends nothing", header("Linux", TRC_HEADER_SIZE), 0, 0, true, 0,
       "Trace buffer is empty"},
      {"a new file holds the records, not the stale bytes", "", 1, 1, true, 1, ""},
      {"a file that cannot be created", "", 1, 0, false, 0, "Unable to create file \"%s\"",
       "none/f.trc"},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.what);
    klptest::TmpDir files;
    std::string path = files.path() + row.file;
    if (!row.existing.empty()) save(path, row.existing);
    int n = row.entries + row.stale;
    Image img(48 * row.entries, 0, 48 * n, row.entries);
    for (int i = 0; i < n; ++i) img.rec(48 * i, 48, 1, 1, 4);
    snprintf(img.h()->fileName, TRC_KEY_SIZE, "%s", path.c_str());
    int rc = -1;
    std::string said = stdoutOf([&] { rc = trcFlushToFile(img.h(), true); });
    std::string expected = row.said;
    if (expected.find("%s") != std::string::npos) expected.replace(expected.find("%s"), 2, path);
    EXPECT_NE(std::string::npos, said.find(expected)) << said;
    EXPECT_EQ(row.ok, rc == 0);
    EXPECT_EQ(row.records, walkFile(path).records.size());
  }
}

TEST(TraceVersion, IncompatibleHeadersAreRefused) {
  struct Row {
    const char *platform, *structure, *symbols;
    uint16_t components, functions;
    bool compatible;
    const char* said;
  };
  std::vector<Row> rows = {
      {"Linux", "0012", "0024", 54, 250, true, ""},
      {"Windows", "0012", "0024", 54, 250, false,
       "Shared buffer was generated by an incompatible Trace version.\nIt uses: platform "
       "Windows, trace structure 0012, and symbol table 0024 (54x250)\nThis is: platform Linux, "
       "trace structure 0012, and symbol table 0024 (54x250)\n"},
      {"Linux", "0011", "0024", 54, 250, false, "incompatible"},
      {"Linux", "0012", "0024", 55, 250, false, "incompatible"},
      {"Linux", "0012", "0024", 54, 251, false, "incompatible"},
      {"Linux", "0012", "0023", 50, 250, true,
       "Warning: Shared buffer uses a different symbol table (0023, 50x250) than this version "
       "of Trace (0024, 54x250).\n"},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.platform + std::string(row.structure) + row.symbols);
    trcBlockHeader h{};
    strcpy(h.platform, row.platform);
    strcpy(h.structVersion, row.structure);
    strcpy(h.symbolVersion, row.symbols);
    h.componentCount = row.components;
    h.functionsPerComponent = row.functions;
    bool compatible = false;
    std::string text = stdoutOf([&] { compatible = trcCheckVersion(&h, nullptr, true); });
    EXPECT_EQ(row.compatible, compatible);
    EXPECT_TRUE(*row.said ? text.find(row.said) != std::string::npos : text.empty()) << text;
  }
}

TEST(TraceThreads, HashedSlotsOverflowAndLookups) {
  Trace t;  // entries are mirrored into the block while tracing
  auto set = [](uint32_t id, const char* name) {
    trcThreadData e{};
    e.threadId = id;
    strcpy(e.threadName, name);
    trcSetThreadData(&e);
  };
  set(0x1234, "first");                   // slot 0x1234 % 150 = 10
  set(0x1234 + 150, "collides");          // overflow entry 0
  // Overflow entries 1..148, then entry 149 taken in turn by each new id.
  for (uint32_t k = 2; k <= 151; ++k) set(0x1234 + 150 * k, "more");
  set(0x1234 + 150 * 152, "last");
  for (const auto& [id, name] : std::vector<std::pair<uint32_t, const char*>>{
           {0x1234, "first"}, {0x1234 + 150, "collides"}, {0x1234 + 150 * 149, "more"},
           {0x1234 + 150 * 150, "UNKNOWN THREAD2"}, {0x1234 + 150 * 151, "UNKNOWN THREAD2"},
           {0x1234 + 150 * 152, "last"}, {11, "UNKNOWN THREAD1"}, {0xFFFFFFFF, "UNKNOWN THREAD1"}})
    EXPECT_STREQ(name, trcGetThreadData(id)->threadName) << id;
  EXPECT_STREQ("tid = 0x34120000", trcGetThreadData(0x1234)->threadIdText);
  EXPECT_STREQ("first", t.b()->threadTable[10].threadName);
  EXPECT_STREQ("last", t.b()->threadOverflow[149].threadName);
}

// Any process may attach to a block; only the declared server holds it, others leave its hold alone.
TEST(TraceAttach, OnlyTheServerHoldsTheBlock) {
  struct Row {
    const char* what;
    bool application, held;  // attaching as the server; the server holds the block already
    uint32_t status;         // put in the block first (0: left running)
    const char* platform;
    mode_t mode;       // given to the block first (0: left as made)
    const char* seen;  // trcAttach's answer, attached or not, the flag while attached
    uint16_t flagAfter;
    bool kept;  // the block's name still exists afterwards
    bool stopMidway = false;  // turned off after the first record: the next check silences the rest
  };
  auto shmPath = [](const std::string& dir) {
    HSVResID id;
    hsvIPCGetResID((dir + kKey + ".TRC").c_str(), HSV_MEMORY_RESID_OPTION, &id);
    return std::string("/dev/shm") + id.posixName();
  };
  const uint32_t stop = TRC_STATE_STOP;
  std::vector<Row> rows = {
      {"the server", true, false, 0, "Linux", 0, "0 1 ffff", 0, true},
      {"another process while the server holds it", false, true, 0, "Linux", 0, "0 1 ffff", 0xFFFF,
       true},
      {"another process finds it turned off, the server still holding it", false, true, stop,
       "Linux", 0, "0 0 ffff", 0xFFFF, true},
      {"the server finds it turned off", true, false, stop, "Linux", 0, "0 0 0", 0, false},
      {"readable by others", true, false, 0, "Linux", 0644, "1000 0 0", 0, true},
      {"another platform", true, false, 0, "Windows", 0, "1004 0 0", 0, true},
      {"still being built", true, false, TRC_STATE_STARTING, "Linux", 0, "0 0 0", 0, true},
      {"another process, turned off while it writes", false, false, 0, "Linux", 0, "0 1 0", 0, true, true},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.what);
    Trace t;
    trcBlockHeader* shared = t.b();  // the child inherits this mapping
    if (row.held) shared->appAttached = TRC_APP_ATTACHED;
    if (row.status != 0) shared->status = row.status;
    if (row.mode != 0) chmod(shmPath(t.dir.path()).c_str(), row.mode);
    strcpy(shared->platform, row.platform);
    klptest::Child c = klptest::inChild(t.dir.path(), [&] {
      trcInitAnchor();
      if (row.application) trcDeclareApplication();
      int rc = trcAttach(t.dir.path().c_str(), kKey, nullptr, nullptr);
      printf("%d %d %x", rc, trcGetAnchor()->block != nullptr, shared->appAttached);
      put(7);
      if (row.stopMidway) {
        shared->status = TRC_STATE_STOP;  // as "off" leaves it
        trcCheckStop();
        shared->status = TRC_STATE_RUNNING;  // the anchor alone keeps the point silent now
        put(8);
        if (trcAnchorState() != TRC_STATE_STOPPING || trcGetAnchor()->block == nullptr) return 2;
      }
      trcDetach();
      return 0;
    });
    EXPECT_EQ(0, c.exitCode) << c.err;
    EXPECT_EQ(row.seen, c.out);
    EXPECT_EQ(row.flagAfter, shared->appAttached);
    EXPECT_EQ(row.kept, access(shmPath(t.dir.path()).c_str(), F_OK) == 0);
    t.b()->status = TRC_STATE_RUNNING;
    strcpy(t.b()->platform, "Linux");
    Walk w = t.read();
    ASSERT_EQ(row.seen[2] == '1' ? 1u : 0u, w.records.size());
    if (!w.records.empty()) { EXPECT_NE(hsvProcessID(), w.records[0].pid); }
  }
}

// Leaves this process `spare` more bytes of private memory, as a machine short of memory would.
void leaveOnly(rlim_t spare) {
  std::string status = klptest::readFile("/proc/self/status");
  rlim_t used = std::stoull(status.substr(status.find("VmData:") + 7)) * 1024;
  rlimit limit{used + spare, used + spare};
  ASSERT_EQ(0, setrlimit(RLIMIT_DATA, &limit));
}

TEST(TraceCommand, InsideTheServerOrShortOfMemory) {
  struct Row {
    const char* what;
    bool server;    // called in the traced server (declared, attached unless turned off)
    bool stopped;   // the block was turned off before
    bool short_;    // no memory for a copy of the 16 MB block
    std::vector<std::string> args;
    const char* said;  // all of the output in the server, within it otherwise
    uint16_t flag;     // the block's attached flag afterwards
    bool kept;      // the block's name still exists
    size_t dumped;  // records in the dump file
  };
  klptest::TmpDir files;
  const std::string dump = files.path() + "dump.trc";
  const char* hint = "Unable to obtain memory to copy buffer for formatting.\nEither make more memory "
                     "available or use the '-holdlock' option\n(this will impact the performance of "
                     "the running application.)\n";
  std::vector<Row> rows = {
      {"off in the server leaves the freeing to its stop check", true, false, false, {"off"},
       "Trace is turned off.\n", 0xFFFF, true, 0},
      {"a server finding the trace turned off lets go of it", true, true, false, {"stat"},
       "Trace is not on.\n", 0, false, 0},
      {"fmt without a copy names the way out", false, false, true, {"fmt"}, hint, 0, true, 0},
      {"fmt -holdlock formats the live block", false, false, true,
       {"fmt", "-holdlock", "-d", "2"}, "fnc_data \"value          \" lvl 2\n", 0, true, 0},
      {"dmp -holdlock dumps the live block", false, false, true, {"dmp", dump, "-holdlock"}, "",
       0, true, 1},
      {"dmp without a copy dumps nothing", false, false, true, {"dmp", dump}, "", 0, true, 0},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.what);
    remove(dump.c_str());
    Trace t(16 << 20);
    put(1);
    if (row.stopped) t.b()->status = TRC_STATE_STOP;
    klptest::Child c = klptest::inChild(files.path(), [&] {
      klpEnvClear(klpGetEnv());
      if (row.server) {
        trcInitAnchor();
        trcDeclareApplication();
        trcAttach(t.dir.path().c_str(), kKey, nullptr, nullptr);
      }
      if (row.short_) leaveOnly(8 << 20);
      std::vector<std::string> args = {"klptrc", "-db", "TDB", "-kcap"};
      args.insert(args.begin() + 1, row.args.begin(), row.args.end());
      std::vector<char*> argv;
      for (std::string& a : args) argv.push_back(a.data());
      return _klpTrace(static_cast<int>(argv.size()), argv.data());
    });
    EXPECT_EQ(0, c.exitCode) << c.err;
    // In the server all it says is said; a formatted trace says more.
    EXPECT_TRUE(row.server ? c.out == row.said : c.out.find(row.said) != std::string::npos)
        << c.out;
    EXPECT_EQ(0, t.b()->bufferLock);
    EXPECT_EQ(0x3F, t.b()->globalFilter);  // the format filters are given back
    EXPECT_STREQ("", t.b()->fileName);     // so is the block's own file name
    EXPECT_EQ(row.flag, t.b()->appAttached);
    EXPECT_EQ(row.kept, klptest::memoryExists(t.dir.path() + kKey + ".TRC"));
    EXPECT_EQ(row.dumped, walkFile(dump).records.size());
  }
}

}  // namespace
