// Formatting and time helpers: exact texts, buffer bounds, parse round trips.
#include "common/util/klpfmt.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <string>
#include <vector>

#include "common/env/klpenv.h"
#include "common/msg/klplog.h"
#include "common/msg/msglogger.h"
#include "common/platform/hsv.h"
#include "common/util/klprc.h"
#include "tests/testing/klptest.h"

namespace {

const uint8_t kLogPos[10] = {0, 1, 2, 3, 4, 5, 6, 7, 8, 9};

// Local time equals UTC while a test runs, so local texts are fixed.
class Fmt : public ::testing::Test {
 protected:
  void SetUp() override {
    const char* tz = getenv("TZ");
    hadTz_ = tz != nullptr;
    oldTz_ = tz ? tz : "";
    setenv("TZ", "UTC", 1);
    tzset();
  }
  void TearDown() override {
    hadTz_ ? setenv("TZ", oldTz_.c_str(), 1) : unsetenv("TZ");
    tzset();
  }
  bool hadTz_ = false;
  std::string oldTz_;
};

// A process logger writing to a log file in its own directory.
struct LogFile {
  klptest::TmpDir dir;
  klptest::ProcessLogger logger{MSG_APP_KLPKCCMD, dir.path(), "fmt.log"};
  std::string text() const { return klptest::readFile(dir.path() + "fmt.log"); }
};

// A variable identifier followed by bytes that must never show up.
std::vector<uint8_t> varId(std::initializer_list<uint8_t> bytes, int16_t count) {
  std::vector<uint8_t> v(2);
  memcpy(v.data(), &count, 2);
  v.insert(v.end(), bytes.begin(), bytes.end());
  v.insert(v.end(), 4, 0xAA);
  return v;
}

}  // namespace

TEST_F(Fmt, IdentifiersAndTheirBufferBounds) {
  char buf[64];
  EXPECT_EQ(24, formatLogPosWords(buf, sizeof buf, "", kLogPos, ""));
  EXPECT_STREQ("0001:0203:0405:0607:0809", buf);
  EXPECT_EQ(24, formatLogPosBytes(buf, sizeof buf, "", kLogPos, ""));
  EXPECT_STREQ("0001:0203:0405:0607:0809", buf);
  const uint8_t high[10] = {0xff, 0xfe, 0, 0, 0, 0, 0, 0, 0x80, 0x01};
  formatLogPosWords(buf, sizeof buf, "<", high, ">");
  EXPECT_STREQ("<fffe:0000:0000:0000:8001>", buf);
  EXPECT_EQ(9, formatNumPair(buf, sizeof buf, "", 12, 345, ""));
  EXPECT_STREQ("0012:0345", buf);
  const uint8_t lsn[8] = {0x01, 0x23, 0x45, 0x67, 0x89, 0xab, 0xcd, 0xef};
  EXPECT_EQ(16, formatLsn(buf, 50, "", lsn, ""));
  EXPECT_STREQ("0123456789abcdef", buf);

  // Too small: nothing below 17 characters, else the notice; never a part.
  memset(buf, 'x', sizeof buf);
  EXPECT_EQ(0, formatLogPosWords(buf, 10, "", kLogPos, ""));
  EXPECT_EQ(0, formatLogPosBytes(buf, 16, "", kLogPos, ""));
  EXPECT_EQ('x', buf[0]);
  EXPECT_EQ(15, formatLogPosWords(buf, 20, "", kLogPos, ""));
  EXPECT_STREQ("...buffer full\n", buf);
  EXPECT_EQ(15, formatLogPosWords(buf, 39, "ab", kLogPos, "c"));  // prefix + suffix + 36
  EXPECT_EQ(27, formatLogPosWords(buf, 40, "ab", kLogPos, "c"));
  EXPECT_EQ(15, formatLogPosBytes(buf, 41, "", kLogPos, ""));
  EXPECT_EQ(24, formatLogPosBytes(buf, 42, "", kLogPos, ""));
  EXPECT_EQ(15, formatLsn(buf, 18, "ab", lsn, ""));
  EXPECT_EQ(16, formatLsn(buf, 19, "ab", lsn, ""));

  // Variable identifiers: bytes past the count are not the identifier's.
  EXPECT_EQ(14, formatVarId(buf, sizeof buf, "", varId({1, 2, 3, 4, 5}, 5).data(), ""));
  EXPECT_STREQ("0102:0304:0500", buf);
  formatVarId(buf, sizeof buf, "<", varId({0x7f}, 1).data(), ">");
  EXPECT_STREQ("<7f00>", buf);
  formatVarId(buf, sizeof buf, "", varId({}, -3).data(), "");
  EXPECT_STREQ("0000", buf);
  auto four = varId({0xde, 0xad, 0xbe, 0xef}, 4);
  EXPECT_EQ(15, formatVarId(buf, 25, "", four.data(), ""));  // 2 x 4 + 4 / 2 + 15
  EXPECT_EQ(9, formatVarId(buf, 26, "", four.data(), ""));
  EXPECT_STREQ("dead:beef", buf);

  testing::internal::CaptureStdout();
  printLogPosWords("[", kLogPos, "]");
  printLogPosBytes("", kLogPos, "");
  printNumPair("", 7, 1234, "|");
  printLogPosWords(std::string(240, 'p').c_str(), kLogPos, "");  // beyond the 256 work buffer
  EXPECT_EQ("[0001:0203:0405:0607:0809]0001:0203:0405:0607:0809\n0007:1234|...buffer full\n",
            testing::internal::GetCapturedStdout());
}

TEST_F(Fmt, HexTextAndDump) {
  char buf[16];
  memset(buf, 'x', sizeof buf);
  auto id = varId({0xab, 0xcd, 0x0f}, 3);
  EXPECT_EQ(-1, formatHex(id.data(), buf, 6));
  EXPECT_EQ('x', buf[0]);
  EXPECT_EQ(6, formatHex(id.data(), buf, 7));
  EXPECT_STREQ("ABCD0F", buf);

  std::vector<uint8_t> data;
  for (int i = 0; i < 25; ++i) data.push_back(static_cast<uint8_t>('A' + i));
  data[2] = 0x07;
  char* out = nullptr;
  size_t len = 0;
  FILE* f = open_memstream(&out, &len);
  hexDump(data.size(), data.data(), f, false);
  hexDump(4, data.data(), f, true);
  fclose(f);
  std::string line1 = "41420744 45464748 494A4B4C 4D4E4F50 51525354  AB.DEFGHIJKLMNOPQRST\n";
  std::string line2 = "55565758 59       " + std::string(27, ' ') + " UVWXY\n";
  char addr[32];
  snprintf(addr, sizeof addr, " %08lx ",
           static_cast<unsigned long>(reinterpret_cast<uintptr_t>(data.data())));
  std::string line3 = std::string(addr) + "41420744 " + std::string(36, ' ') + " AB.D\n";
  EXPECT_EQ(line1 + line2 + line3, std::string(out, len));
  free(out);
}

TEST_F(Fmt, TimestampsParseAndPrint) {
  int64_t s = -1;
  int32_t us = -1;
  ASSERT_EQ(0, timestamp2seconds("1970-01-02-01.01.01", &s, &us));
  EXPECT_EQ(90061, s);
  EXPECT_EQ(0, us);
  ASSERT_EQ(0, timestamp2seconds("2026-12-06-11.43.08.123456", &s, &us));
  EXPECT_EQ(123456, us);
  char back[20];
  secondsToTimestamp(s, back);
  EXPECT_STREQ("2026-12-06-11.43.08", back);
  ASSERT_EQ(0, timestamp2seconds("2026/12/06 11:43:08", &s, &us));  // separators not examined
  secondsToTimestamp(s, back);
  EXPECT_STREQ("2026-12-06-11.43.08", back);

  char buf[KLP_TIMESTAMP_BUF];
  formatLocalTimestamp(0, 0, buf, sizeof buf, false);
  EXPECT_STREQ("Un-initialized", buf);
  formatLocalTimestamp(90061, 5, buf, sizeof buf, true);
  EXPECT_STREQ("1970-01-02T01:01:01.000005", buf);
  formatLocalTimestamp(90061, 0, buf, sizeof buf, false);
  EXPECT_STREQ("01-02-1970 01:01:01", buf);
  struct Utc { int64_t s; int32_t us; char style; const char* text; };
  for (const Utc& c : {Utc{0, 0, 'C', "Un-initialized"}, {90061, 0, 'X', "1970-01-02T01:01:01"},
                       {90061, 42, 'C', "01-02-1970 01:01:01.000042"},
                       {90061, 42, 'D', "1970-01-02-01.01.01"}}) {
    formatUtcTimestamp(c.s, c.us, buf, sizeof buf, c.style);
    EXPECT_STREQ(c.text, buf) << c.style;
  }
  EXPECT_EQ(0, formatUtcTimestamp(90061, 0, buf, sizeof buf, 'Q'));
  EXPECT_STREQ("1970-01-02-01.01.01", buf);  // untouched
  char small[8];
  formatUtcTimestamp(90061, 0, small, sizeof small, 'D');
  EXPECT_STREQ("1970-01", small);

  formatDuration(90061, buf, sizeof buf);
  EXPECT_STREQ("  1d  1h  1m  1s", buf);
  formatMillis(3723004, buf, sizeof buf);
  EXPECT_STREQ(" 1h  2m  3.004s", buf);
  formatMillis32(59999, buf, sizeof buf);
  EXPECT_STREQ(" 0h  0m 59.999s", buf);

  // A wrong length is reported with the length, on a line of its own.
  LogFile log;
  EXPECT_EQ(-1, timestamp2seconds("2026-12-06-11.43.08.12345", &s, nullptr));
  EXPECT_EQ(-1, timestamp2seconds(nullptr, &s, nullptr));
  EXPECT_NE(std::string::npos, log.text().find("<timestamp2seconds> KLP8999D Expected timestamp "
                                               "len of 19 or 26. Received 25\n"))
      << log.text();
  // Fields with more digits than a number holds are no time.
  for (const char* huge : {"99999999999999999999999999", "2026-12-06-11.999999999999",
                           "2026-12-999999999999999999"}) {
    s = 7;
    EXPECT_EQ(-1, timestamp2seconds(huge, &s, nullptr)) << huge;
    EXPECT_EQ(0, s) << huge;
  }
  EXPECT_EQ(5u, klptest::lines(log.text()).size()) << log.text();
}

TEST_F(Fmt, PackedDecimalDatesAndFractionPrecision) {
  char out[40];
  memset(out, '#', sizeof out);
  const uint8_t date[4] = {0x20, 0x26, 0x12, 0x06};
  bcdDateToText(date, out);
  EXPECT_EQ("2026-12-06#", std::string(out, 11));  // no NUL written
  const uint8_t time[3] = {0x11, 0x43, 0x08};
  bcdTimeToText(time, out);
  EXPECT_EQ("11.43.08", std::string(out, 8));

  const uint8_t ts[11] = {0x20, 0x26, 0x12, 0x06, 0x11, 0x43, 0x08, 0x12, 0x34, 0x56, 0x78};
  klpReleaseBlock& rel = klpGetEnv()->appVersion.rel;
  klpReleaseBlock saved = rel;
  rel.version = 9;
  rel.release = 5;  // before 9.7: six fraction digits at most
  memset(out, '#', sizeof out);
  EXPECT_EQ(28, bcdTimestampToText(ts, sizeof ts, 8, 8, out));
  EXPECT_EQ("2026-12-06-11.43.08.12345600#", std::string(out, 29));
  rel.release = 7;
  EXPECT_EQ(28, bcdTimestampToText(ts, sizeof ts, 8, 8, out));
  EXPECT_EQ("2026-12-06-11.43.08.12345678", std::string(out, 28));
  EXPECT_EQ(28, bcdTimestampToText(ts, 8, 8, 8, out));  // only the bytes that exist
  EXPECT_EQ("2026-12-06-11.43.08.12000000", std::string(out, 28));
  EXPECT_EQ(-1, bcdTimestampToText(ts, 6, 0, 8, out));
  rel = saved;
}

TEST_F(Fmt, StringCopyIdentifiersWordsAndPads) {
  LogFile log;
  char dst[6] = "xxxxx";
  EXPECT_EQ(0, copyStringIntoBuffer(dst, "abcde", 6));
  EXPECT_EQ(KLP_RC_TOO_LONG, copyStringIntoBuffer(dst, "abcdef", 6));
  EXPECT_STREQ("abcde", dst);
  EXPECT_NE(std::string::npos, log.text().find("String size exeeds buffer size"));

  int32_t len = -1;
  char quoted[] = "\"ab\"\"c\"";
  EXPECT_EQ(0, checkIdentifier(quoted, &len));
  EXPECT_EQ(4, len);
  char empty[] = "\"\"";
  EXPECT_EQ(0, checkIdentifier(empty, &len));
  EXPECT_EQ(0, len);
  char plain[] = "MixedCase1";
  EXPECT_EQ(0, checkIdentifier(plain, &len));
  EXPECT_STREQ("MIXEDCASE1", plain);
  for (std::string bad : {"ab\"c", "\"abc", "\"a\"b\"", "\"", "\"ab\"\"\"\""})
    EXPECT_EQ(KLP_RC_BAD_PARM, checkIdentifier(bad.data(), &len)) << bad;

  klpWord words[2] = {{6, "select"}, {4, "FROM"}};
  auto has = [&](const char* t) {
    return searchWordSequence(static_cast<int32_t>(strlen(t)), t, 2, words);
  };
  EXPECT_EQ(1, has("x = 1; SELECT \t\r\n from t"));
  EXPECT_EQ(1, has("sselect from"));  // the breaking character may start the word
  EXPECT_EQ(0, has("select x from"));
  EXPECT_EQ(0, has("sel ect from"));  // a separator inside a word starts over
  EXPECT_EQ(0, searchWordSequence(10, "select from", 2, words));

  char pad[2] = {'z', 'z'};
  EXPECT_EQ(2, getPadChar(941, pad));
  EXPECT_EQ(0x40, pad[1]);
  EXPECT_EQ(KLP_RC_UNKNOWN_CCSID, getPadChar(819, pad));
  EXPECT_EQ(0x40, pad[1]);
}

TEST_F(Fmt, ProgramFilesOpenUnderTheirNames) {
  LogFile log;
  klptest::TmpDir dir;  // after the log's, so that it is the TMPDIR in force
  klpEnv* env = klpGetEnv();
  ASSERT_EQ(0, klpEnvClear(env));
  setEnvTovRIB(env, "fmttestprogram", 9, 7, 8);
  FILE* f = nullptr;
  char name[256];
  ASSERT_EQ(0, getFileHandle(&f, KLP_FILE_TEMP | KLP_FILE_WRITE, "dat", name, sizeof name,
                             nullptr, 0));
  std::string expected = dir.path() + "fmttestpr." + std::to_string(hsvProcessID()) + ".dat";
  EXPECT_EQ(expected, name);
  fputs("hello", f);
  fclose(f);
  ASSERT_EQ(0, getFileHandle(&f, KLP_FILE_TEMP | KLP_FILE_APPEND | KLP_FILE_BINARY, "dat",
                             nullptr, 0, nullptr, 0));
  fputs(" again", f);
  fclose(f);
  EXPECT_EQ("hello again", klptest::readFile(expected));

  char err[8] = "old";
  EXPECT_EQ(ENOENT,
            getFileHandle(&f, KLP_FILE_TEMP, "missing", name, sizeof name, err, sizeof err));
  EXPECT_EQ(nullptr, f);
  EXPECT_STREQ("", name);
  EXPECT_STREQ("", err);
  EXPECT_NE(std::string::npos, log.text().find("KLP0626")) << log.text();
  char tiny[8];  // a name that does not fit is not opened at all
  EXPECT_EQ(ENAMETOOLONG, getFileHandle(&f, KLP_FILE_TEMP | KLP_FILE_WRITE, "x", tiny,
                                        sizeof tiny, nullptr, 0));
  klpEnvClear(env);
}

TEST_F(Fmt, WildcardPreparationAndMatching) {
  struct Prepared { const char* in; int32_t kind; const char* out; };
  for (const Prepared& c :
       {Prepared{"AB%", KLP_WILD_PREFIX, "AB%"}, {"%%%", KLP_WILD_ALL, "%"},
        {"A%B%", KLP_WILD_FULL, "A%B%"}, {"A\\%B", KLP_WILD_NONE, "A%B"},
        {"A%%B", KLP_WILD_FULL, "A%B"}, {"AB\\%%", KLP_WILD_PREFIX, "AB%%"},
        {"A\\%%%B", KLP_WILD_FULL, "A\\%%B"}}) {
    std::string p = c.in;
    EXPECT_EQ(c.kind, prepareIgnTransCriteria(p.data())) << c.in;
    EXPECT_STREQ(c.out, p.c_str()) << c.in;
  }
  // A later occurrence is tried when the first one leads nowhere; "%" may
  // come before an escaped character.
  struct Match { const char* pattern; const char* text; int result; };
  for (const Match& m :
       {Match{"A%C", "ABBC", 1}, {"A%C", "ABBD", 0}, {"%", "", 1}, {"", "x", 0}, {"a%c", "ABC", 0},
        {"A%B%C", "AxByBzC", 1}, {"A%C", "ABCC", 1}, {"A%CD", "ACXCD", 1}, {"A\\%C", "A%C", 1},
        {"A\\%C", "ABC", 0}, {"%\\%", "50%", 1}, {"A\\", "A\\", 0}})
    EXPECT_EQ(m.result, compareIgnTransCriteria(m.pattern, m.text)) << m.pattern << " " << m.text;
}
