// Formatting and time helpers: exact texts, buffer bounds, the records the
// helpers log, and the answers worked out once per process.
#include "common/util/klpfmt.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <ctime>
#include <functional>
#include <regex>
#include <string>
#include <tuple>
#include <vector>

#include "common/env/klpenv.h"
#include "common/parms/klpparm.h"
#include "common/platform/hsv.h"
#include "common/util/klprc.h"
#include "tests/testing/klptest.h"
#include "xqpub/xqpubparms.h"

namespace {

const uint8_t kLogPos[10] = {0, 1, 2, 3, 4, 5, 6, 7, 8, 9};
const uint8_t kLsn[8] = {0x01, 0x23, 0x45, 0x67, 0x89, 0xab, 0xcd, 0xef};

// Local time is UTC in this test program, so local texts are fixed.
const bool kUtc = (setenv("TZ", "UTC", 1), tzset(), true);

// A variable identifier followed by bytes that must never show up.
std::vector<uint8_t> varId(std::initializer_list<uint8_t> bytes, int16_t count) {
  std::vector<uint8_t> v(2);
  memcpy(v.data(), &count, 2);
  v.insert(v.end(), bytes.begin(), bytes.end());
  v.insert(v.end(), 4, 0xAA);
  return v;
}

// "answer:text" of a call with buffer b of k = size characters ("x" where nothing
// was written; "overflow" when it wrote beyond them).
std::string into(size_t size, const std::function<int(char*, size_t)>& f) {
  char buf[300];
  memset(buf, 'x', sizeof buf);
  int n = f(buf, size);
  if (std::string(buf + size, 8) != "xxxxxxxx") return "overflow";
  return std::to_string(n) + ":" + std::string(buf, strnlen(buf, size));
}
#define INTO(size, call) into(size, [&](char* b, [[maybe_unused]] size_t k) { return call; })

}  // namespace

TEST(Fmt, TextsAndTheirBufferBounds) {
  const uint8_t high[10] = {0xff, 0xfe, 0, 0, 0, 0, 0, 0, 0x80, 0x01}, three[3] = {0x00, 0xab, 0x7f};
  const uint8_t ts[11] = {0x20, 0x26, 0x12, 0x06, 0x11, 0x43, 0x08, 0x12, 0x34, 0x56, 0x78};
  const auto four = varId({0xde, 0xad, 0xbe, 0xef}, 4), hex = varId({0xab, 0xcd, 0x0f}, 3);
  klpReleaseBlock& rel = klpGetEnv()->appVersion.rel;
  const klpReleaseBlock saved = rel;
  rel.version = 9;
  // Too small: nothing below 17 characters, else the notice; never a part.
  const std::string full = "15:...buffer full\n";
  const std::pair<std::string, std::string> cases[] = {
      {INTO(64, formatLogPosWords(b, k, "<", high, ">")), "26:<fffe:0000:0000:0000:8001>"},
      {INTO(17, formatLogPosWords(b, k, "", kLogPos, "")), full},
      {INTO(39, formatLogPosWords(b, k, "ab", kLogPos, "c")), full},  // prefix + suffix + 36
      {INTO(40, formatLogPosWords(b, k, "ab", kLogPos, "c")), "27:ab0001:0203:0405:0607:0809c"},
      {INTO(16, formatLogPosBytes(b, k, "", kLogPos, "")), "0:xxxxxxxxxxxxxxxx"},
      {INTO(41, formatLogPosBytes(b, k, "", kLogPos, "")), full},
      {INTO(42, formatLogPosBytes(b, k, "", kLogPos, "")), "24:0001:0203:0405:0607:0809"},
      {INTO(26, formatNumPair(b, k, "a", 12, 345, "")), full},
      {INTO(27, formatNumPair(b, k, "a", 12, 345, "")), "10:a0012:0345"},
      {INTO(18, formatLsn(b, k, "ab", kLsn, "")), full},
      {INTO(19, formatLsn(b, k, "ab", kLsn, "")), "16:ab0123456789abcdef"},
      // Variable identifiers: bytes past the count are not the identifier's.
      {INTO(64, formatVarId(b, k, "", varId({1, 2, 3, 4, 5}, 5).data(), "")), "14:0102:0304:0500"},
      {INTO(64, formatVarId(b, k, "<", varId({0x7f}, 1).data(), ">")), "6:<7f00>"},
      {INTO(64, formatVarId(b, k, "", varId({}, -3).data(), "")), "4:0000"},
      {INTO(25, formatVarId(b, k, "", four.data(), "")), full},  // 2 x 4 + 4 / 2 + 15
      {INTO(26, formatVarId(b, k, "", four.data(), "")), "9:dead:beef"},
      {INTO(6, formatHex(hex.data(), b, k)), "-1:xxxxxx"},
      {INTO(7, formatHex(hex.data(), b, k)), "6:ABCD0F"},
      {INTO(6, formatHexUpper(three, 3, b, k)), "-1:xxxxxx"},
      {INTO(7, formatHexUpper(three, 3, b, k)), "6:00AB7F"},
      {INTO(1, formatHexUpper(three, 0, b, k)), "0:"},
      // Local times, month first or ISO; UTC in styles C, X and D.
      {INTO(40, formatLocalTimestamp(0, 0, b, k, false)), "14:Un-initialized"},
      {INTO(40, formatLocalTimestamp(0, 0, b, k, true)), "19:1970-01-01T00:00:00"},
      {INTO(40, formatLocalTimestamp(90061, 5, b, k, true)), "26:1970-01-02T01:01:01.000005"},
      {INTO(40, formatLocalTimestamp(90061, 1, b, k, false)), "26:01-02-1970 01:01:01.000001"},
      {INTO(40, formatLocalTimestamp(90061, 0, b, k, false)), "19:01-02-1970 01:01:01"},
      {INTO(40, formatUtcTimestamp(0, 0, b, k, 'C')), "14:Un-initialized"},
      {INTO(40, formatUtcTimestamp(0, 0, b, k, 'X')), "19:1970-01-01T00:00:00"},
      {INTO(40, formatUtcTimestamp(90061, 42, b, k, 'C')), "26:01-02-1970 01:01:01.000042"},
      {INTO(40, formatUtcTimestamp(90061, 0, b, k, 'C')), "19:01-02-1970 01:01:01"},
      {INTO(40, formatUtcTimestamp(90061, 1, b, k, 'X')), "26:1970-01-02T01:01:01.000001"},
      {INTO(40, formatUtcTimestamp(90061, 42, b, k, 'D')), "19:1970-01-02-01.01.01"},
      {INTO(8, formatUtcTimestamp(90061, 0, b, k, 'D')), "7:1970-01"},
      {INTO(8, formatUtcTimestamp(90061, 0, b, k, 'Q')), "0:xxxxxxxx"},
      {INTO(40, formatDuration(90061, b, k)), "16:  1d  1h  1m  1s"},
      {INTO(40, formatMillis(7140004, b, k)), "15: 1h 59m  0.004s"},
      {INTO(40, formatMillis32(59999, b, k)), "15: 0h  0m 59.999s"},
      {INTO(20, (secondsToTimestamp(1796557388, b), 19)), "19:2026-12-06-11.43.08"},
      // Packed decimal: no NUL written; more than six fraction digits only
      // from level 9.7 on, and never more than the bytes hold.
      {INTO(12, (bcdDateToText(ts, b), 0)), "0:2026-12-06xx"},
      {INTO(10, (bcdTimeToText(ts + 4, b), 0)), "0:11.43.08xx"},
      {INTO(30, (rel.release = 6, bcdTimestampToText(ts, 11, 8, 8, b))),
       "28:2026-12-06-11.43.08.12345600xx"},
      {INTO(30, (rel.release = 7, bcdTimestampToText(ts, 11, 8, 8, b))),
       "28:2026-12-06-11.43.08.12345678xx"},
      {INTO(30, (rel.version = 10, rel.release = 0, bcdTimestampToText(ts, 11, 8, 8, b))),
       "28:2026-12-06-11.43.08.12345678xx"},
      {INTO(30, bcdTimestampToText(ts, 8, 8, 8, b)), "28:2026-12-06-11.43.08.12000000xx"},
      {INTO(30, bcdTimestampToText(ts, 11, 1, 8, b)), "21:2026-12-06-11.43.08.1xxxxxxxxx"},
      {INTO(20, bcdTimestampToText(ts, 7, 0, 8, b)), "19:2026-12-06-11.43.08x"},
      {INTO(4, bcdTimestampToText(ts, 6, 0, 8, b)), "-1:xxxx"},
  };
  for (const auto& [got, want] : cases) EXPECT_EQ(got, want);
  rel = saved;

  // The print forms, bounded by their 256-character work buffer.
  const std::string p239(239, 'p'), p240(240, 'p');
  auto printed = klptest::stdoutOf([&] {
    printLogPosWords("[", kLogPos, "]");
    printLogPosBytes("", kLogPos, "");
    printNumPair("", 7, 1234, "|");
    printVarId("<", varId({1, 2, 3}, 3).data(), ">");
    printLsn("", kLsn, "\n");
    printLsn(p239.c_str(), kLsn, "");
    printLsn(p240.c_str(), kLsn, "");
    printLogPosWords(p240.c_str(), kLogPos, "");
    printVarId(std::string(236, 'p').c_str(), four.data(), "");
  });
  EXPECT_EQ(printed, "[0001:0203:0405:0607:0809]0001:0203:0405:0607:0809\n0007:1234|<0102:0300>"
                     "0123456789abcdef\n" + p239 + "0123456789abcdef...buffer full\n"
                     "...buffer full\n...buffer full\n");
  // The dump: twenty bytes a line in groups of four, the printable ones after them.
  const char data[] = "abcdefghijklmnopqrst\x01z";
  printed = klptest::stdoutOf([&] {
    hexDump(22, data, stdout, false);
    hexDump(1, data, stdout, true);
  });
  EXPECT_EQ(printed.substr(0, 116),
            "61626364 65666768 696A6B6C 6D6E6F70 71727374  abcdefghijklmnopqrst\n017A" +
                std::string(42, ' ') + ".z\n");
  EXPECT_TRUE(std::regex_match(printed.substr(116), std::regex(" [0-9a-f]{8,} 61 {44}a\n")))
      << printed;
}

TEST(Fmt, IdentifiersWordsAndPads) {
  struct { std::string in; int rc; std::string out; int32_t len; } ids[] = {
      {"\"ab\"\"c\"", 0, "\"ab\"\"c\"", 4}, {"\"\"", 0, "\"\"", 0}, {"Mixed1", 0, "MIXED1", 6},
      {"ab\"c", 2002, "ab\"c", -1}, {"\"abc", 2002, "\"abc", -1}, {"\"a\"b\"", 2002, "\"a\"b\"", -1},
      {"\"", 2002, "\"", -1}, {"\"ab\"\"\"\"", 2002, "\"ab\"\"\"\"", -1}};
  for (auto c : ids) {
    int32_t len = -1;
    EXPECT_EQ(c.rc, checkIdentifier(c.in.data(), &len)) << c.in;
    EXPECT_EQ(c.out + "/" + std::to_string(c.len), c.in + "/" + std::to_string(len));
  }

  klpWord words[2] = {{6, "select"}, {4, "FROM"}};
  // The character that breaks a match may start the first word again; a
  // separator inside a word starts over.
  for (auto [text, found] : {std::pair<std::string, int>{"x = 1; SELECT \t\r\n from t", 1},
                             {"sselect from", 1}, {"select x from", 0}, {"sel ect from", 0}})
    EXPECT_EQ(found, searchWordSequence(static_cast<int32_t>(text.size()), text.c_str(), 2, words));
  EXPECT_EQ(0, searchWordSequence(10, "select from", 2, words));
  EXPECT_EQ(KLP_RC_BAD_PARM, checkIdentifier(nullptr, nullptr));

  struct { std::vector<int> ccsids; std::string pad; } pads[] = {
      {{1208, 1209, 947, 1252}, " "}, {{1200}, std::string("\x30\x00", 2)},
      {{37, 273, 277, 278, 285, 424, 500}, "@"}, {{941}, "\x81\x40"}, {{819, 0, 1201, 36}, ""}};
  for (const auto& p : pads) {
    for (int ccsid : p.ccsids) {
      char out[2] = {'z', 'z'};
      EXPECT_EQ(p.pad.empty() ? KLP_RC_UNKNOWN_CCSID : static_cast<int>(p.pad.size()),
                getPadChar(ccsid, out)) << ccsid;
      EXPECT_EQ(p.pad + std::string(2 - p.pad.size(), 'z'), std::string(out, 2)) << ccsid;
    }
  }
}

// The answer is kept once the program and its parameter set are known, and
// only then: each case runs in a process of its own.
TEST(Fmt, CompatibilityLevelOfTheServerWorkedOutOnce) {
  klptest::TmpDir dir;
  struct { const char* program; const char* level; int answer; } cases[] = {
      {"xqpub", "0802", 0}, {"xqpub", "0901", 0}, {"xqpub", "0905", 0}, {"xqpub", "0801", 1},
      {"xqpub", "\"0905\"", 1}, {"xqpubcmd", "0802", 1}, {"xqpu", "0905", 1}};
  for (const auto& c : cases) {
    klptest::Child r = klptest::inChild(dir.path(), [&] {
      klpEnvClear(klpGetEnv());
      ParmEntry t[XQPUB_PARM_COUNT];
      int rc = (buildXqpubParmTable(t), 0);
      xqpubParms p(t, XQPUB_PARM_COUNT, &rc);
      int unknown = getCompatibilityLevel();  // no parameter set yet
      klpSetCurrentParms(&p);
      unknown += getCompatibilityLevel();  // no program name yet
      setEnvTovRIB(klpGetEnv(), c.program, 9, 7, 8);
      p.setParm(33, c.level, PARM_SRC_COMMANDLINE);
      int first = getCompatibilityLevel();
      p.setParm(33, first ? "0802" : "0700", PARM_SRC_CHGPARMS);
      setEnvTovRIB(klpGetEnv(), first ? "xqpub" : "other", 9, 7, 8);
      return unknown == 2 && getCompatibilityLevel() == first ? first : 12;
    });
    EXPECT_EQ(c.answer, r.exitCode) << c.program << " " << c.level;
  }
}

// The program's own files, and each helper that reports: its answer and its records.
TEST(Fmt, ProgramFilesAndTheReportsOfTheHelpers) {
  klptest::TmpDir dir;
  klptest::ProcessLogger log;
  klpEnv* env = klpGetEnv();
  ASSERT_EQ(0, klpEnvClear(env));
  setEnvTovRIB(env, "fmttestprogram", 9, 7, 8);
  FILE* f = nullptr;
  char name[256], err[8] = "old", tiny[8];
  const std::string temp = dir.path() + "fmttestpr." + std::to_string(hsvProcessID());
  ASSERT_EQ(0, getFileHandle(&f, KLP_FILE_TEMP | KLP_FILE_WRITE, "dat", name, sizeof name, nullptr, 0));
  EXPECT_EQ(temp + ".dat", name);
  fputs("hello", f), fclose(f);
  ASSERT_EQ(0, getFileHandle(&f, KLP_FILE_TEMP | KLP_FILE_APPEND | KLP_FILE_BINARY, "dat", nullptr, 0,
                             nullptr, 0));
  fputs(" again", f), fclose(f);
  EXPECT_EQ("hello again", klptest::readFile(name));
  // Without the temporary flag: the path parameter and the name prefix.
  ParmEntry t[XQPUB_PARM_COUNT];
  buildXqpubParmTable(t);
  int rc = 0;
  xqpubParms parms(t, XQPUB_PARM_COUNT, &rc);
  for (auto [i, v] : {std::pair<int, const char*>{PARM_IDX_SERVER, "DB"}, {PARM_IDX_SCHEMA, "K"},
                      {PARM_IDX_PATH, dir.path().c_str()}})
    parms.setParm(i, v, PARM_SRC_COMMANDLINE);
  klpSetCurrentParms(&parms);
  ASSERT_EQ(0, setEnvNamePrefix(env, "W"));
  ASSERT_EQ(0, getFileHandle(&f, KLP_FILE_WRITE, "log", name, sizeof name, nullptr, 0));
  fclose(f);
  EXPECT_EQ(dir.path() + "DB.K.W.log", name);
  log.take();

  char dst[6] = "xxxxx";
  int64_t s = 7;
  const std::string len = "8999 <timestamp2seconds> 12: Expected timestamp len of 19 or 26. Received ",
                    mktime = "8999 <timestamp2seconds> 12: mktime could not calculate seconds";
  int32_t us = -1;
  // The answer, then the records logged.
  const std::pair<std::function<int()>, std::vector<std::string>> cases[] = {
      // Seconds (or microseconds) of the local time; the separators are not examined.
      {[&] { return timestamp2seconds("1970-01-02-01.01.01", &s, &us) ? -1 : int(s) + us; }, {"90061"}},
      {[&] { return timestamp2seconds("2026/12/06 11:43:08", &s, &us) ? -1 : int(s); }, {"1796557388"}},
      {[&] { return timestamp2seconds("2026-12-06-11.43.08.123456", &s, &us) ? -1 : us; }, {"123456"}},
      {[&] { return copyStringIntoBuffer(dst, "abcde", 6); }, {"0"}},
      {[&] { return copyStringIntoBuffer(dst, "abcdef", 6); },
       {"6005", "569 <copyStringIntoBuffer> 12: String size exeeds buffer size"}},
      {[&] { return timestamp2seconds("2026-12-06-11.43.08.12345", &s, nullptr); }, {"-1", len + "25"}},
      {[&] { return timestamp2seconds(nullptr, &s, nullptr); }, {"-1", len + "0"}},
      // Fields with more digits than a number holds are no time.
      {[&] { return timestamp2seconds("99999999999999999999999999", &s, nullptr); }, {"-1", mktime}},
      {[&] { return timestamp2seconds("2026-12-06-11.999999999999", &s, nullptr); }, {"-1", mktime}},
      {[&] { return getFileHandle(&f, KLP_FILE_TEMP, "none", name, sizeof name, err, sizeof err); },
       {"2", "626 <getFileHandle> 1: fopen|" + temp + ".none|rt|2"}},
      // A name that does not fit is not opened at all.
      {[&] { return getFileHandle(&f, KLP_FILE_WRITE, "x", tiny, sizeof tiny, nullptr, 0); },
       {"36", "626 <getFileHandle> 1: fopen|" + dir.path() + "DB.K.W.x|wt+|36"}},
  };
  for (const auto& [call, want] : cases) {
    std::vector<std::string> got = {std::to_string(call())};
    for (const std::string& r : log.take()) got.push_back(r);
    EXPECT_EQ(got, want);
  }
  EXPECT_EQ(std::string(dst) + "/" + name + "/" + err + "/" + std::to_string(s) + (f ? "f" : ""), "abcde///0");
  klpSetCurrentParms(nullptr);
  klpEnvClear(env);
}

TEST(Fmt, WildcardPreparationAndMatching) {
  const std::tuple<std::string, int32_t, std::string> prepared[] = {
      {"AB%", KLP_WILD_PREFIX, "AB%"}, {"%%%", KLP_WILD_ALL, "%"}, {"A%B%", KLP_WILD_FULL, "A%B%"},
      {"A\\%B", KLP_WILD_NONE, "A%B"}, {"A%%B", KLP_WILD_FULL, "A%B"},
      {"AB\\%%", KLP_WILD_PREFIX, "AB%%"}, {"A\\%%%B", KLP_WILD_FULL, "A\\%%B"}};
  for (auto [in, kind, out] : prepared) {
    EXPECT_EQ(kind, prepareIgnTransCriteria(in.data())) << out;
    EXPECT_EQ(out, in.c_str());
  }
  // A later occurrence is tried when the first one leads nowhere; "%" may
  // come before an escaped character.
  const std::tuple<const char*, const char*, int> matches[] = {
      {"A%C", "ABBC", 1}, {"A%C", "ABBD", 0}, {"%", "", 1}, {"", "x", 0}, {"a%c", "ABC", 0},
      {"A%B%C", "AxByBzC", 1}, {"A%C", "ABCC", 1}, {"A%CD", "ACXCD", 1}, {"A\\%C", "A%C", 1},
      {"A\\%C", "ABC", 0}, {"%\\%", "50%", 1}, {"A\\", "A\\", 0}};
  for (auto [pattern, text, result] : matches)
    EXPECT_EQ(result, compareIgnTransCriteria(pattern, text)) << pattern << " " << text;
}
