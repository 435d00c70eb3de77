// The trace command's argument parser: complaints first, then what the
// values become, and the filters they set.
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "common/trace/trace.h"
#include "common/trace/trcopts.h"
#include "tests/testing/klptest.h"

namespace {

struct Parsed {
  std::vector<std::string> args;  // the options point into them
  trcOptions o;
  std::string said;
};

Parsed parse(std::vector<std::string> args) {
  Parsed p;
  p.args = args;
  p.args.insert(p.args.begin(), "klptrc");
  std::vector<char*> argv;
  for (std::string& a : p.args) argv.push_back(a.data());
  p.said = klptest::stdoutOf([&] { trcParseArgs(static_cast<int>(argv.size()), argv.data(), &p.o); });
  trcFreeOptions(&p.o);  // filters are looked at through the block only
  return p;
}

}  // namespace

TEST(TraceOptions, ComplaintsEndParsingOrGoOn) {
  struct Case {
    std::vector<std::string> args;
    std::string said;
  } cases[] = {
      {{"-ofn"}, "Error: No file name specified for \"-ofn\" option.\n"},
      {{"dmp"}, "Error: Dump file name not specified.\n"},
      {{"-fn"}, "Error: No file name specified for \"-fn\" option.\n"},
      {{"-fs"}, "Error: No size specified for \"-fs\" option.\n"},
      {{"-b"}, "Error: No size specified for \"-b\" option.\n"},
      {{"-d"}, "Error: No log diagnostic level specified for \"-d\" option.\n"},
      {{"-o"}, "Error: No out diagnostic level specified for \"-o\" option.\n"},
      {{"-SUBsystem"}, "Error: No name specified for \"-SUBsystem\" option.\n"},
      {{"-qualifier"}, "Error: No suffix specified for \"-qualifier\" option.\n"},
      {{"-df"}, "Error: No function or component name specified for \"-df\" option.\n"},
      {{"-df", "main"}, "Error: No diagnostic level mask specified for \"-df\" option.\n"},
      {{"onx", "-b", "64K", "-fs", "4G"},
       "Unknown option \"onx\", ignored...\nBuffer size adjusted to 131072\n"
       "File size adjusted to 131072\n"},
  };
  for (const Case& c : cases) {
    Parsed p = parse(c.args);
    EXPECT_TRUE(p.o.error) << c.args[0];
    EXPECT_EQ(p.said, c.said);
  }
}

TEST(TraceOptions, ValuesAndLevels) {
  Parsed p = parse({"ON", "Fmt", "-Db", "sample", "-kcap", "-b", "3m", "-fs", "3000000000", "-o",
                    "1,3", "-schema", "qa", "dmp", "/tmp/x"});
  EXPECT_FALSE(p.o.error) << p.said;
  EXPECT_EQ(p.said, "File size adjusted to 2147483647\n");
  EXPECT_TRUE(p.o.on && p.o.fmt && p.o.dmp);
  EXPECT_EQ(std::string(p.o.dbName), "sample");
  EXPECT_EQ(std::string(p.o.kind), "KCAP");
  EXPECT_EQ(std::string(p.o.schema), "qa");
  EXPECT_EQ(std::string(p.o.fileName), "/tmp/x");
  EXPECT_EQ(p.o.bufferSize, 3145728u);
  EXPECT_EQ(p.o.outLevel, 5);
  EXPECT_EQ(p.o.logLevel, 0x7FFF);
  EXPECT_FALSE(p.o.levelGiven);

  struct Level {
    const char* list;
    uint16_t mask;
    const char* text;
  } levels[] = {{"1,3", 5, "1,3"}, {"7", 0, "0"}, {"", 0, "0"}, {"2,4x6", 10, "2,4"},
                {"654321", 63, "1,2,3,4,5,6"}};
  for (const Level& l : levels) {
    EXPECT_EQ(trcParseLevels(l.list), l.mask) << l.list;
    char text[16];
    trcLevelText(l.mask, text);
    EXPECT_STREQ(text, l.text);
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
