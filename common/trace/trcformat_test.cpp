// The formatter over images built byte by byte, its object formatters and styles; the argument parser.
#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <string>
#include <tuple>
#include <vector>

#include "common/trace/trace.h"
#include "common/trace/trace_anchor.h"
#include "common/trace/trcformat.h"
#include "common/trace/trcjson.h"
#include "common/trace/trcobjfmt.h"
#include "common/trace/trcopts.h"
#include "tests/testing/klptest.h"

namespace {

using Bytes = std::string;

std::string object(unsigned type, const Bytes& data, bool hex = false) {
  return klptest::stdoutOf([&] {
    trcFormatObject(stdout, type, static_cast<uint32_t>(data.size()),
                    reinterpret_cast<const uint8_t*>(data.data()), hex);
  });
}
Bytes times(const Bytes& b, int n) { Bytes all; while (n-- > 0) all += b; return all; }

Bytes le16(uint16_t v) { return Bytes(reinterpret_cast<const char*>(&v), 2); }
Bytes le32(uint32_t v) { return Bytes(reinterpret_cast<const char*>(&v), 4); }
Bytes le64(uint64_t v) { return Bytes(reinterpret_cast<const char*>(&v), 8); }
Bytes timeValue(int64_t seconds, int32_t micro) {
  return le64(static_cast<uint64_t>(seconds)) + Bytes(4, '\0') + le32(static_cast<uint32_t>(micro));
}
// One 56-byte SQLDA column: type, length, name.
Bytes column(uint16_t type, uint16_t length, const std::string& name, uint16_t nameLength) {
  Bytes c = le16(type) + le16(length) + Bytes(20, '\0') + le16(nameLength) + name;
  c.resize(56, '\0');
  return c;
}
Bytes sqlda(int16_t count, const Bytes& columns) {
  return Bytes(14, '\0') + le16(static_cast<uint16_t>(count)) + columns;
}

// A trace image: a header and the records appended to its data area.
struct Image {
  Image() : bytes_(TRC_HEADER_SIZE, '\0') {
    trcBlockHeader* h = header();
    strcpy(h->platform, "Linux");
    strcpy(h->structVersion, "0012");
    strcpy(h->symbolVersion, "0024");
    h->componentCount = 54;
    h->functionsPerComponent = 250;
    h->dataOffset = TRC_HEADER_SIZE;
    h->globalFilter = 0x7FFF;
    for (int i = 0; i < 150; ++i) h->threadTable[i].key = h->threadOverflow[i].key = 0xFFFFFFFF;
  }
  trcBlockHeader* header() { return reinterpret_cast<trcBlockHeader*>(bytes_.data()); }
  void nameThread(uint32_t tid, const std::string& name) {
    trcThreadData& e = header()->threadTable[tid % 150];
    e.key = e.threadId = tid;
    memcpy(e.threadName, name.data(), std::min(name.size(), sizeof e.threadName));
  }
  // timeOrName: a time value (entry and exit) or the 16-byte name field.
  void add(uint8_t type, uint16_t component, uint16_t function, uint32_t tid, uint16_t level,
           const Bytes& timeOrName, const std::vector<std::pair<uint16_t, Bytes>>& objects = {}) {
    Bytes body;
    for (auto& [t, data] : objects) {
      Bytes o = le16(t) + le16(static_cast<uint16_t>(data.size())) + data;
      o.resize((o.size() + 3) & ~size_t{3}, '\0');
      body += o;
    }
    Bytes rec = le32(static_cast<uint32_t>(40 + body.size())) + le16(level) +
                le16(static_cast<uint16_t>(objects.size())) + le16(component) + le16(function) +
                le32(7) + le32(tid) + timeOrName + Bytes(1, static_cast<char>(type)) +
                Bytes(3, '\0') + body;
    bytes_ += rec;
    trcBlockHeader* h = header();
    h->writeOffset = h->highWaterOffset = static_cast<uint32_t>(bytes_.size() - TRC_HEADER_SIZE);
    ++h->entryCount;
  }
  trcImage image() { return trcImage{header(), bytes_.size(), false}; }
  Bytes bytes_;
};

Bytes name16(const std::string& n) { return n + Bytes(15 - n.size(), ' ') + Bytes(1, '\0'); }

// Two threads of process 7: 0x11 named "worker one", 0x22 not named.
Image twoThreads() {
  Image im;
  im.nameThread(0x11, "worker one");
  im.add(1, 11, 2, 0x11, 1, timeValue(1, 1));
  im.add(3, 11, 2, 0x11, 2, name16("first data"), {{3, Bytes("hello", 6)}});
  im.add(1, 11, 42, 0x22, 1, timeValue(1, 3));
  im.add(4, 11, 2, 0x11, 1, timeValue(1, 4), {{13, le16(5)}});
  im.add(4, 11, 42, 0x22, 1, timeValue(1, 5));  // an exit value without its object
  im.add(3, 53, 200, 0x22, 4, name16("x"), {{1, le32(42)}});
  return im;
}

enum Style { FLW, FMT, V7, JSON };
std::string format(Image& im, Style style, uint16_t level = 0x7FFF,
                   std::vector<trcFilter> filters = {}) {
  trcBlockHeader* h = im.header();
  h->globalFilter = level;
  trcApplyFilters(h, filters.data(), static_cast<int>(filters.size()));
  trcLoadThreadTables(h);
  return klptest::stdoutOf([&] {
    if (style == FLW) trcFormatFlow(stdout, im.image());
    if (style == FMT) trcFormatFull(stdout, im.image(), false);
    if (style == V7) trcFormatV7(stdout, im.image());
    if (style == JSON) trcFormatJson(stdout, im.image());
  });
}

void expectGolden(const std::string& name, const std::string& got) {
  EXPECT_EQ(got, klptest::readFile(KLP_SOURCE_DIR "/common/trace/" + name + ".golden"));
}

struct Parsed {
  std::vector<std::string> args;  // the options point into them
  trcOptions o;
  std::string said;
};

Parsed parse(std::vector<std::string> args) {
  Parsed p{args, {}, ""};
  p.args.insert(p.args.begin(), "klptrc");
  std::vector<char*> argv;
  for (std::string& a : p.args) argv.push_back(a.data());
  p.said = klptest::stdoutOf([&] { trcParseArgs(static_cast<int>(argv.size()), argv.data(), &p.o); });
  trcFreeOptions(&p.o);  // filters are looked at through the block only
  return p;
}

struct Formatter : ::testing::Test {
  void SetUp() override { setenv("TZ", "UTC", 1), tzset(); }
};

}  // namespace

// Damaged objects (a note and the bytes), whole ones, and -hex, which dumps strings too.
TEST_F(Formatter, ObjectsDamagedOrWhole) {
  const std::pair<unsigned, Bytes> cases[] = {
      {1, Bytes("\x01\x02\x03", 3)}, {19, le64(5)}, {18, Bytes(9, '\1')}, {15, Bytes(1, '\3')},
      {5, sqlda(3, column(452, 10, "A", 1))}, {5, sqlda(1, column(452, 10, "A", 31))},
      {19, timeValue(INT64_MAX, 0)}, {1, Bytes("\xff", 1)}, {1, le16(0xFFFE)},
      {21, le32(16) + "\xaa"}, {13, le16(0xFFFE)}, {16, le32(0xFFFFFFFF)}, {3, Bytes("a\nb", 4)},
      {2, "xyz"}, {17, Bytes(4, '\0')}, {17, Bytes("\0\1", 2)}, {18, le64(0x1234)},
      {15, le16(3)}, {15, le16(99)}, {22, Bytes("\3", 1)}, {22, le32(6)}, {19, timeValue(0, 5)},
      {4, Bytes(12, '\0') + le32(static_cast<uint32_t>(-204))},
      {5, sqlda(2, column(485, 0x0207, "AMOUNT", 6) + column(452, 10, "NAME", 4))},
      {6, ""}, {6, "SELECT A FROM T"}, {6, std::string(75, 'X') + " B"},
      {0, Bytes("AB\0\xff" "C", 5)}, {0, ""}, {30, "A"}};
  std::string got;
  for (const auto& [type, data] : cases) got += std::to_string(type) + ": " + object(type, data);
  expectGolden("trcformat_objects", got + "hex 3: " + object(3, "hi", true));
}

TEST_F(Formatter, StatementAndDescriptorListingsStopWhenFull) {
  const std::string in = "\n         ";
  EXPECT_EQ(object(6, times("AAAAAAAAA ", 7) + "AAAAAAAAA"),
            in + times("AAAAAAAAA ", 6) + in + "AAAAAAAAA AAAAAAAAA\n");
  EXPECT_EQ(object(6, "(" + std::string(70, 'B')), in + "(" + in + std::string(70, 'B') + "\n");
  std::string listed = object(6, times("AAAAAAAAAA ", 500));  // lines of 76 characters
  EXPECT_LT(listed.size(), 4000u);
  EXPECT_EQ(listed.substr(listed.size() - 15), "...buffer full\n");
  std::string cols = object(5, sqlda(400, times(column(452, 10, std::string(30, 'N'), 30), 400)));
  EXPECT_LT(cols.size(), 20000u);
  EXPECT_EQ(cols.substr(cols.size() - 24), "         ...buffer full\n");
}

// Styles of two threads; level 2 alone, an override back to 1; lost entries (flow indents from the least).
TEST_F(Formatter, StylesAndFilters) {
  Image im = twoThreads(), wrapped;
  wrapped.add(2, 11, 3, 0x11, 1, timeValue(2, 1));
  wrapped.add(2, 11, 2, 0x11, 1, timeValue(2, 2));
  wrapped.add(1, 11, 4, 0x11, 1, timeValue(2, 3));
  // Level 4 shows its time; json keeps UTF-8 and takes other bytes as Latin-1.
  wrapped.add(3, 11, 4, 0x11, 8, name16("timed"), {{19, timeValue(2, 4)}, {3, Bytes("\xc3\xa9\xe9", 4)}});
  std::string name = "CMDSHANDLEMESSAGE", got = format(im, FMT);
  for (const std::string& part : {format(im, FLW), format(im, V7), format(im, JSON),
                                  format(im, FLW, 2), format(im, FLW, 2, {{name.c_str(), 1}}),
                                  format(wrapped, FLW), format(wrapped, JSON)})
    got += "--\n" + part;  // a braced list is formatted in order
  expectGolden("trcformat_styles", got);
}

TEST_F(Formatter, FullWidthFieldsStayWithinTheirFields) {
  Image im;
  trcBlockHeader* h = im.header();
  memset(h->traceRelease.uniqueName, 'U', sizeof h->traceRelease.uniqueName);
  memset(h->traceRelease.jobName, 'J', sizeof h->traceRelease.jobName);
  im.nameThread(0x11, std::string(64, 'N'));
  memset(h->threadTable[0x11].data, 'D', sizeof h->threadTable[0x11].data);
  memset(h->threadTable[0x11].threadIdText, 'T', sizeof h->threadTable[0x11].threadIdText);
  im.add(1, 11, 2, 0x11, 1, timeValue(1, 1));
  expectGolden("trcformat_fullwidth", klptest::stdoutOf([&] {
                 trcFormatStyles(stdout, im.image(), false, true, false, false);
               }));
}

TEST(TraceOptions, ComplaintsEndParsingOrGoOn) {
  std::string said;
  for (const std::vector<std::string>& args : std::vector<std::vector<std::string>>{
           {"-ofn"}, {"dmp"}, {"-fn"}, {"-fs"}, {"-b"}, {"-d"}, {"-o"}, {"-SUBsystem"},
           {"-qualifier"}, {"-df"}, {"-df", "main"}, {"onx", "-b", "64K", "-fs", "4G"}}) {
    Parsed p = parse(args);
    EXPECT_TRUE(p.o.error) << args[0];
    said += "$";
    for (const std::string& a : args) said += " " + a;
    said += "\n" + p.said;
  }
  expectGolden("trcopts_complaints", said);
}

TEST(TraceOptions, ValuesAndLevels) {
  Parsed p = parse({"ON", "Fmt", "-Db", "sample", "-kcap", "-b", "3m", "-fs", "3000000000", "-o",
                    "1,3", "-schema", "qa", "dmp", "/tmp/x"});
  EXPECT_FALSE(p.o.error) << p.said;
  EXPECT_EQ(p.said, "File size adjusted to 2147483647\n");
  EXPECT_TRUE(p.o.on && p.o.fmt && p.o.dmp);
  EXPECT_EQ(std::string(p.o.dbName) + " " + p.o.kind + " " + p.o.schema + " " + p.o.fileName,
            "sample KCAP qa /tmp/x");
  EXPECT_EQ(p.o.bufferSize, 3145728u);
  EXPECT_EQ(p.o.outLevel, 5);
  EXPECT_EQ(p.o.logLevel, 0x7FFF);
  EXPECT_FALSE(p.o.levelGiven);
  for (auto [list, mask, said] : std::vector<std::tuple<const char*, uint16_t, const char*>>{
           {"1,3", 5, "1,3"}, {"7", 0, "0"}, {"", 0, "0"}, {"2,4x6", 10, "2,4"},
           {"654321", 63, "1,2,3,4,5,6"}}) {  // level list, mask, mask as text
    EXPECT_EQ(trcParseLevels(list), mask) << list;
    char text[16];
    trcLevelText(mask, text);
    EXPECT_STREQ(text, said);
  }
}

TEST(TraceOptions, FiltersSetOverrideWords) {
  static trcBlockHeader h;
  const trcFilter filters[] = {{"capture/apply common function", 1},
                               {"OrdList::putHead", 2},
                               {"ORDLIST::PUTHEAD", 6}};  // the later one wins
  trcApplyFilters(&h, filters, 3);
  EXPECT_EQ(h.componentFilters[11], 0x8001);
  EXPECT_EQ(h.functionFilters[11][2], 0x8006);
  int overrides = 0;
  for (auto& row : h.functionFilters)
    for (uint16_t w : row) overrides += (w & 0x8000) != 0;
  for (uint16_t w : h.componentFilters) overrides += (w & 0x8000) != 0;
  EXPECT_EQ(overrides, 2);
}
