// Composition of message texts: built-in table, header values, the value
// length bound, substitution and the internal-error fallback.
#include <gtest/gtest.h>

#include <cstring>
#include <string>

#include "common/msg/msglogger.h"

namespace {

// The plain logger has no catalogue, so texts come from the table only.
struct TextTest : ::testing::Test {
  msgLogger logger{MSG_APP_KLPKCCMD, 0};
  void SetUp() override {
    logger.loadBuiltinMsgs(builtinMsgTable);
    logger.setProgramQualifier("KLP");
  }
  std::string text(int number, const char* thread, const char* v1 = nullptr,
                   const char* v2 = nullptr, const char* v3 = nullptr) {
    char buf[2048];
    logger.getKlpMsgText(number, "test", thread, buf, sizeof buf, v1, v2, v3);
    return buf;
  }
  // A record as putKlpMsg fills it: nine values, missing ones "*".
  logMsg* record(int number, const char* thread, int count, const char* const* values) {
    logMsg* r = msgNewRecord(number, 0, "test", thread);
    const char* all[MSG_MAX_VALUES] = {};
    for (int i = 0; i < count && i < MSG_MAX_VALUES; ++i) all[i] = values[i];
    logger.setMsgValues(r, MSG_MAX_VALUES, all);
    return r;
  }
};

TEST_F(TextTest, BuiltinTableLoadsWellFormedRowsOnceAndFirstDefinitionWins) {
  msgLogger fresh(MSG_APP_KLPKCCMD, 0);
  EXPECT_EQ(116, fresh.loadBuiltinMsgs(builtinMsgTable));
  EXPECT_EQ(0, fresh.loadBuiltinMsgs(builtinMsgTable));
  EXPECT_EQ(0, fresh.loadBuiltinMsgs(nullptr));
  const char* empty[] = {nullptr};
  EXPECT_EQ(0, fresh.loadBuiltinMsgs(empty));

  for (const char* bad : {"KLP0000D zero", "KLP9999D too big", "XYZ8100D not ours", "KLP81", "KLP8a00D"})
    EXPECT_EQ(0, fresh.addBuiltinMsg(bad)) << bad;
  EXPECT_EQ(0, fresh.addBuiltinMsg(nullptr));
  EXPECT_EQ(1, fresh.addBuiltinMsg("KLP8100D first"));
  EXPECT_EQ(0, fresh.addBuiltinMsg("KLP8100D second"));
  // 8200 shares the bucket of 8100 and 8000 but is its own key.
  EXPECT_EQ(1, fresh.addBuiltinMsg("KLP8200D other"));

  char buf[64];
  fresh.getKlpMsgText(8100, "t", "T", buf, sizeof buf);
  EXPECT_STREQ("KLP8100D first", buf);
  fresh.getKlpMsgText(8200, "t", "T", buf, sizeof buf);
  EXPECT_STREQ("KLP8200D other", buf);
  EXPECT_EQ(1, fresh.lookupBuiltinMsg(8100, 0, nullptr));
  EXPECT_EQ(0, fresh.lookupBuiltinMsg(8300, 0, nullptr));
  EXPECT_EQ(0, fresh.lookupBuiltinMsg(-1, 0, nullptr));
  EXPECT_EQ(0, fresh.lookupBuiltinMsg(-100, 0, nullptr));
  // Every row has a well-formed id; override rows ("~") name the external one.
  for (const char* const* p = builtinMsgTable; *p != nullptr; ++p) {
    const char* row = *p;
    SCOPED_TRACE(row);
    ASSERT_EQ(0, strncmp(row, "KLP", 3));
    if (row[7] == '~') {
      ASSERT_EQ(0, strncmp(row + 8, " KLP", 4));
      EXPECT_NE(nullptr, strchr("EIWD", row[16]));
    } else {
      EXPECT_NE(nullptr, strchr("EIWD", row[7]));
    }
  }
}

TEST_F(TextTest, GivenExamplesComposeExactly) {
  EXPECT_EQ("KLP8999D Message logging re-enabled", text(8999, "T", "Message logging re-enabled"));
  EXPECT_EQ("KLP8006D  \"KlpKCcmd\" : \"KLP\" : \"T\" : Element \"X\" is out of range.",
            text(8006, "T", "X"));
  EXPECT_EQ("KLP8000D  \"KlpKCcmd\" : \"KLP\" : \"T\" : List element named \"E\" is invalidly "
            "chainedon list named \"L\".",
            text(8000, "T", "E", "L"));
}

TEST_F(TextTest, UnknownNumberBecomesInternalErrorShowingItsValues) {
  EXPECT_EQ("KLP0553W  \"KlpKCcmd\" : \"KLP\" : \"T\" : An internal error  \"4\" occurred for "
            "message number \"600\" containing \"9\" substitution fields: \"KlpKCcmd\", "
            "\"KLP\" : \"T\", \"A\", \"B\", \"*\", \"*\", \"*\", \"*\", \"*\"",
            text(600, "T", "A", "B"));
  // Negative numbers are outside the table, never an out-of-range bucket.
  std::string neg = text(-7, "T", "A");
  EXPECT_EQ(0u, neg.find("KLP0553W")) << neg;
  EXPECT_NE(std::string::npos, neg.find("message number \"-7\" containing \"9\"")) << neg;
  EXPECT_NE(std::string::npos, neg.find("fields: \"A\", \"*\"")) << neg;
}

TEST_F(TextTest, OverrideRowShowsExternalIdWithItsHeaderValues) {
  const char* v[] = {"x"};
  logMsg* r = record(9011, "T", 1, v);
  logger.composeKlpMsg(r);
  EXPECT_STREQ("KLP7654E  \"KlpKCcmd\" : \"KLP\" : \"T\" : The autostop and applyupto parameters "
               "cannot be specified at the same time when operating the K Apply program. ",
               r->text);
  EXPECT_EQ(7654, r->msgNumber);
  EXPECT_EQ(9011, r->internalNumber);
  EXPECT_EQ(MSG_SOURCE_OVERRIDE, r->sourceKind);
  EXPECT_STREQ("KlpKCcmd", r->values[0]);
  EXPECT_STREQ("x", r->values[2]);
  msgFreeRecord(r);
}

TEST_F(TextTest, HeaderValuesFollowTheNumberRangesAndPushOutTheLastCallerValues) {
  // Headers: 0 none, 1 qualifier-and-thread, 2 application then it.
  const std::pair<int, int> cases[] = {
      {0, 1},    {499, 1},  {500, 2},  {999, 2},  {1000, 1}, {1499, 1}, {1500, 0},
      {1975, 0}, {1976, 2}, {1999, 2}, {2000, 0}, {3999, 0}, {4000, 2}, {4099, 2},
      {4100, 0}, {5099, 0}, {5100, 1}, {5199, 1}, {5200, 0}, {6999, 0}, {7000, 2},
      {8997, 2}, {8998, 0}, {9999, 0}, {-1, 0}};
  const char* v[] = {"A", "2", "3", "4", "5", "6", "7", "8", "9"};
  for (auto [number, headers] : cases) {
    SCOPED_TRACE(number);
    logMsg* r = record(number, "T", 9, v);
    ASSERT_EQ(9, r->valueCount);
    if (headers == 2) {
      EXPECT_STREQ("KlpKCcmd", r->values[0]);
    }
    if (headers > 0) {
      EXPECT_STREQ("KLP\" : \"T", r->values[headers - 1]);
    }
    EXPECT_STREQ("A", r->values[headers]);
    EXPECT_STREQ(v[8 - headers], r->values[8]);  // the last caller values are pushed out
    msgFreeRecord(r);
  }
}

TEST_F(TextTest, BlankThreadNameTakesTheDefaultAndNamesAreCut) {
  msgSetThreadNameProvider([]() -> const char* { return "a-very-long-thread-name"; });
  msgLoggerU u(MSG_APP_KLPKCCMD, 0);
  u.setProgramQualifier("KLP");
  logMsg* r = msgNewRecord(8006, 0, "o", " ");
  const char* none[MSG_MAX_VALUES] = {};
  u.setMsgValues(r, MSG_MAX_VALUES, none);
  EXPECT_STREQ("a-very-long-thr", r->threadName);
  msgFreeRecord(r);
  msgSetThreadNameProvider(nullptr);

  r = msgNewRecord(1, 0, "0123456789012345678901234567890123456789", "01234567890123456789");
  EXPECT_STREQ("012345678901234567890123456789", r->origin);
  EXPECT_STREQ("012345678901234", r->threadName);
  msgFreeRecord(r);

  std::string q(200, 'Q');
  logger.setProgramQualifier(q.c_str());
  EXPECT_EQ(128u, strlen(logger.getProgramQualifier()));
}

TEST_F(TextTest, ValueLengthBoundCutsLongValuesEvenly) {
  std::string v200(200, 'v');
  const char* nine[9];
  for (auto& p : nine) p = v200.c_str();
  logMsg* r = record(8999, "T", 9, nine);
  for (int i = 0; i < 9; ++i) {
    EXPECT_EQ(129u, r->valueLengths[i]);
    EXPECT_EQ(129u, strlen(r->values[i]));
  }
  msgFreeRecord(r);

  // Values not longer than the share (1161 / 9 = 129) stay whole.
  std::string v1000(1000, 'w'), v129(129, 's');
  const char* mixed[9] = {v129.c_str(), v1000.c_str(), v1000.c_str(), "a", "b",
                          "c",          "d",           "e",           "f"};
  r = record(8999, "T", 9, mixed);
  uint64_t sum = 0;
  for (int i = 0; i < 9; ++i) sum += r->valueLengths[i];
  EXPECT_EQ(129u, r->valueLengths[0]);
  EXPECT_EQ(1u, r->valueLengths[3]);
  EXPECT_LT(r->valueLengths[1], 1000u);
  EXPECT_LE(sum, 1161u + 9u);
  msgFreeRecord(r);

  // One huge value among barely long ones: the even cut exceeds what the
  // short ones hold; they are emptied, never cut below nothing.
  std::string huge(20000, 'h'), v130(130, 'm');
  const char* skew[9] = {v130.c_str(), v130.c_str(), v130.c_str(), v130.c_str(), v130.c_str(),
                         v130.c_str(), v130.c_str(), v130.c_str(), huge.c_str()};
  r = record(8999, "T", 9, skew);
  for (int i = 0; i < 9; ++i) EXPECT_EQ(strlen(r->values[i]), r->valueLengths[i]);
  msgFreeRecord(r);
}

TEST_F(TextTest, SubstitutionFollowsMarkerOrder) {
  char* values[3] = {const_cast<char*>("A"), const_cast<char*>(""), const_cast<char*>("$3")};
  char out[128];
  auto sub = [&](const char* t, int count = 3, int cap = 127) {
    msgSubstitute(t, strlen(t), values, count, out, cap);
    return std::string(out);
  };
  EXPECT_EQ("<A|*|$3>", sub("<$1|$2|$3>"));
  EXPECT_EQ("$2 A", sub("$2 $1"));              // a marker before $1 stays
  EXPECT_EQ("A $1 *", sub("$1 $1 $2"));         // replaced at its first place only
  EXPECT_EQ("A * $3 $5 *", sub("$1 $2 $3 $5 $4"));  // the value "$3" is not searched
  EXPECT_EQ("A $3 *", sub("$1 $3 $2"));         // stops at the first missing marker
  EXPECT_EQ("A * *", sub("$1 $2 $3", 1));       // values beyond the count are "*"
  EXPECT_EQ("no markers", sub("no markers"));
  EXPECT_EQ("x$", sub("x$"));
  EXPECT_EQ("<A|", sub("<$1|$2|$3>", 3, 3));    // cut at the capacity
}

TEST_F(TextTest, ControlCharactersInValuesAreWrittenEscaped) {
  // A value may come from another process (a queue name a client sent): it
  // must never end or split the line its message is written on.
  const struct {
    const char* value;
    const char* shown;
  } cases[] = {
      {"Q1\nKLP0522I forged", "Q1\\nKLP0522I forged"},
      {"a\r\tb", "a\\r\\tb"},
      {"\x1b[31mred\x7f", "\\x1B[31mred\\x7F"},
      {"\x01", "\\x01"},
      {"back\\slash \xc3\xbc", "back\\slash \xc3\xbc"},  // printable and UTF-8 stay
  };
  for (const auto& c : cases)
    EXPECT_EQ(std::string("KLP8999D ") + c.shown, text(8999, "T", c.value)) << c.shown;
  // The header values too: a qualifier with a line feed shows escaped.
  logger.setProgramQualifier("K\nLP");
  EXPECT_EQ("KLP8006D  \"KlpKCcmd\" : \"K\\nLP\" : \"T\" : Element \"X\" is out of range.",
            text(8006, "T", "X"));
}

TEST_F(TextTest, TextIsCutAt1024AndNeverWrittenPastTheBuffer) {
  std::string big(1100, 'z');
  logMsg* r = msgNewRecord(8999, 0, "t", "T");
  const char* v[MSG_MAX_VALUES] = {big.c_str()};
  logger.setMsgValues(r, MSG_MAX_VALUES, v);
  logger.composeKlpMsg(r);
  EXPECT_EQ(1024u, strlen(r->text));
  EXPECT_EQ(0, strncmp(r->text, "KLP8999D zzz", 12));
  msgFreeRecord(r);

  char buf[32];
  memset(buf, '#', sizeof buf);
  EXPECT_EQ(19, logger.getKlpMsgText(8006, "t", "T", buf, 20, "X"));
  EXPECT_EQ("KLP8006D  \"KlpKCcmd", std::string(buf));
  for (size_t i = 20; i < sizeof buf; ++i) EXPECT_EQ('#', buf[i]) << i;
  EXPECT_EQ(0, logger.getKlpMsgText(8006, "t", "T", buf, 0, "X"));
  EXPECT_EQ('K', buf[0]);  // zero length: untouched
}

TEST(LogBaseName, FormsDataSetAndPlainNames) {
  char out[64];
  EXPECT_TRUE(msgLogBaseName("//HLQ", "MY_DB.KLP_X.KCAP", out, sizeof out));
  EXPECT_STREQ("MYDB.KLPX.KCAP.LOG", out);
  EXPECT_TRUE(msgLogBaseName("//HLQ", "ABCDEFGHIJ.KLMNOPQRST.REST.MORE", out, sizeof out));
  EXPECT_STREQ("ABCDEFGH.KLMNOPQR.REST.MORE.LOG", out);
  EXPECT_FALSE(msgLogBaseName("//HLQ", "ONE.PART", out, sizeof out));
  EXPECT_STREQ("", out);
  EXPECT_TRUE(msgLogBaseName("/var/log/", "MYDB.KLP.KCAP", out, sizeof out));
  EXPECT_STREQ("MYDB.KLP.KCAP.log", out);
  EXPECT_FALSE(msgLogBaseName("/x", "a-name-that-does-not-fit-in-eight", out, 8));
  EXPECT_STREQ("", out);
}

}  // namespace
