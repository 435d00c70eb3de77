// Registry rules that can really break: table checks, source priority,
// quoted strings, type checks, LOGSTDOUT mirroring, the query message bytes
// and the parsing of a query message received from another process.
#include <gtest/gtest.h>

#include <clocale>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <cwctype>
#include <string>
#include <vector>

#include "common/msg/msglogger.h"
#include "common/parms/klpparm.h"
#include "common/parms/parmutil.h"
#include "common/util/klprc.h"

namespace {

// A process logger for the test, with stdout captured around each call.
class ParmTest : public ::testing::Test {
 protected:
  void SetUp() override {
    logger_ = createMsgLoggerU(MSG_APP_KLPKCCMD, 0);
    ASSERT_NE(logger_, nullptr);
    logger_->loadBuiltinMsgs(builtinMsgTable);
    klpSetProcessLogger(logger_);
  }
  void TearDown() override {
    klpSetCurrentParms(nullptr);
    klpSetProcessLogger(nullptr);
    delete logger_;
  }
  static void begin() {
    fflush(stdout);
    ::testing::internal::CaptureStdout();
  }
  static std::string end() {
    fflush(stdout);
    return ::testing::internal::GetCapturedStdout();
  }
  msgLogger* logger_ = nullptr;
};

ParmEntry intEntry(int index, const char* name, int lo, int hi, int def, int display = 1) {
  return makeParmEntry(index, name, 0, PARM_INTEGER, lo, hi, def, nullptr, 0, display, 0);
}
ParmEntry boolEntry(int index, const char* name, int def, int display = 1) {
  return makeParmEntry(index, name, 0, PARM_BOOLEAN, -1, -1, -1, nullptr, def, display, 0);
}
ParmEntry strEntry(int index, const char* name, int max, const char* def, int display = 1) {
  return makeParmEntry(index, name, 0, PARM_STRING, -1, max, -1, def, 0, display, 0);
}
ParmEntry cmdEntry(int index, const char* name) {
  return makeParmEntry(index, name, 0, PARM_COMMAND, -1, -1, -1, nullptr, 0, 0, 0);
}

// A small registry with one parameter of each kind; index 4 is LOGSTDOUT.
std::vector<ParmEntry> smallTable() {
  return {strEntry(0, "SERVER", 40, ""),         intEntry(1, "COUNT", 1, 100, 42),
          strEntry(2, "SCHEMA", 8, "KLP"),       cmdEntry(3, "GO"),
          boolEntry(4, "LOGSTDOUT", 0),          strEntry(5, "HIDDEN", 10, "x", 0),
          strEntry(6, "SOMETIMES", 10, "", -1)};
}

TEST_F(ParmTest, ConstructorRefusesBadTables) {
  // 65 entries: refused as a whole, nothing readable afterwards.
  std::vector<ParmEntry> big;
  for (int i = 0; i < 65; ++i) big.push_back(intEntry(i % 64, "P", 0, 9, 0));
  int rc = -5;
  begin();
  klpParmClass tooMany(big.data(), 65, &rc);
  int32_t v = tooMany.getParmInt(0);
  std::string out = end();
  EXPECT_EQ(rc, 0);
  EXPECT_EQ(tooMany.getCount(), 0);
  EXPECT_EQ(v, -1);
  EXPECT_EQ(out,
            "klpParmClass: Error: parameter count (65) is out of range (0-64).\n"
            "Parameter index 0 is out of range.\n");

  // Bad entries are skipped, the good ones still taken.
  ParmEntry longName = intEntry(1, "", 0, 9, 0);
  memset(longName.name, 'N', sizeof longName.name);  // 33 characters, no terminator
  std::vector<ParmEntry> t = {intEntry(0, "GOOD", 0, 9, 5), longName,
                              intEntry(2, "LOWDEFAULT", 10, 20, 3),
                              strEntry(6, "FAR", 10, "")};
  std::string tooLong(1041, 'v');
  t.push_back(strEntry(3, "LONGDEFAULT", 2000, tooLong.c_str()));
  begin();
  klpParmClass bad(t.data(), static_cast<int>(t.size()), &rc);
  out = end();
  EXPECT_EQ(rc, KLP_RC_BAD_PARM);
  EXPECT_NE(out.find("klpParmClass: Error: length of parameter name " + std::string(33, 'N') +
                     " is greater than max (32).\n"),
            std::string::npos);
  EXPECT_NE(out.find("klpParmClass: Error: default value (3) for parameter LOWDEFAULT is out "
                     "of range (10-20)\n"),
            std::string::npos);
  EXPECT_NE(out.find("klpParmClass: Error: parameter index (6) for parameter FAR is out of "
                     "range (0-5).\n"),
            std::string::npos);
  EXPECT_NE(out.find("klpParmClass: Error: length of parameter value " + tooLong +
                     " for parameter LONGDEFAULT is greater than max (1040)\n"),
            std::string::npos);
  EXPECT_EQ(bad.getParmInt(0), 5);
  begin();
  EXPECT_EQ(bad.getParmType(1), PARM_PLACEHOLDER);
  EXPECT_STREQ(bad.getParmName(3), "KLPPLACEHOLDER");
  end();
}

TEST_F(ParmTest, IndexEqualToCountIsStoredButNotReadable) {
  std::vector<ParmEntry> t = {intEntry(0, "A", 0, 9, 1), intEntry(2, "C", 0, 9, 7)};
  int rc = -1;
  klpParmClass p(t.data(), 2, &rc);
  EXPECT_EQ(rc, 0);
  begin();
  EXPECT_EQ(p.getParmInt(2), -1);
  EXPECT_EQ(p.setParm(2, 3, PARM_SRC_COMMANDLINE), KLP_RC_BAD_PARM);
  std::string out = end();
  EXPECT_EQ(out, "Parameter index 2 is out of range.\nParameter index 2 is out of range.\n");

  // With 64 entries an index of 64 has no slot to go to: refused.
  std::vector<ParmEntry> full;
  for (int i = 0; i < 63; ++i) full.push_back(intEntry(i, "P", 0, 9, 0));
  full.push_back(intEntry(64, "EDGE", 0, 9, 0));
  begin();
  klpParmClass edge(full.data(), 64, &rc);
  out = end();
  EXPECT_EQ(rc, KLP_RC_BAD_PARM);
  EXPECT_NE(out.find("parameter index (64) for parameter EDGE is out of range (0-64)"),
            std::string::npos);
}

TEST_F(ParmTest, GettersOfTheWrongTypeAnswerTheirFailureValue) {
  auto t = smallTable();
  int rc = -1;
  klpParmClass p(t.data(), static_cast<int>(t.size()), &rc);
  ASSERT_EQ(rc, 0);
  begin();
  EXPECT_EQ(p.getParmInt(2), -1);
  EXPECT_EQ(p.getParmBool(1), 0);
  EXPECT_EQ(p.getParmString(4), nullptr);
  EXPECT_EQ(p.getParmString(3), nullptr);  // a COMMAND is not a STRING
  EXPECT_EQ(p.getParmType(-1), -1);
  EXPECT_EQ(p.getParmSource(7), -1);
  EXPECT_EQ(p.getParmName(64), nullptr);
  std::string out = end();
  EXPECT_EQ(out,
            "Parameter index 2 is not of type INTEGER.\n"
            "Parameter index 1 is not of type BOOLEAN.\n"
            "Parameter index 4 is not of type STRING.\n"
            "Parameter index 3 is not of type STRING.\n"
            "Parameter index -1 is out of range.\n"
            "Parameter index 7 is out of range.\n"
            "Parameter index 64 is out of range.\n");
  EXPECT_EQ(p.getParmInt(1), 42);
  EXPECT_STREQ(p.getParmString(2), "KLP");
}

TEST_F(ParmTest, HigherSourcesAreNeverReplacedByLowerOnes) {
  auto t = smallTable();
  int rc = -1;
  klpParmClass p(t.data(), static_cast<int>(t.size()), &rc);
  EXPECT_EQ(p.setParm(1, 10, PARM_SRC_CHGPARMS), 0);
  EXPECT_EQ(p.setParm(1, 20, PARM_SRC_COMMANDLINE), 0);  // dropped, still 0
  EXPECT_EQ(p.getParmInt(1), 10);
  EXPECT_EQ(p.getParmSource(1), PARM_SRC_CHGPARMS);
  EXPECT_EQ(p.setParm(1, 30, PARM_SRC_KAPPLY), 0);
  EXPECT_EQ(p.getParmInt(1), 30);

  EXPECT_EQ(p.setParm(2, "ABC", PARM_SRC_SYSTEM), 0);
  EXPECT_EQ(p.setParm(2, "XYZ", PARM_SRC_COMMANDLINE), 0);
  EXPECT_STREQ(p.getParmString(2), "ABC");

  EXPECT_EQ(p.setBool(4, 'y', PARM_SRC_CHGPARMS), 0);
  EXPECT_EQ(p.setParmBool(4, 0, PARM_SRC_TABLE), 0);
  EXPECT_EQ(p.getParmBool(4), 1);

  // A command ignores priority.
  EXPECT_EQ(p.setCommand(3, 1, "first", PARM_SRC_KAPPLY), 0);
  EXPECT_EQ(p.setCommand(3, 1, "second", PARM_SRC_DEFAULT), 0);
  EXPECT_STREQ(p.getCommandText(3), "second");
  EXPECT_EQ(p.getParmSource(3), PARM_SRC_DEFAULT);
  EXPECT_EQ(p.getNamedCommand(), 3);
}

TEST_F(ParmTest, QuotedStringsCountWithoutTheirQuotes) {
  auto t = smallTable();
  int rc = -1;
  klpParmClass p(t.data(), static_cast<int>(t.size()), &rc);
  // Schema holds at most 8 characters.
  EXPECT_EQ(p.setParm(2, "\"ABCDEFGH\"", PARM_SRC_COMMANDLINE), 0);
  EXPECT_STREQ(p.getParmString(2), "\"ABCDEFGH\"");  // kept with its quotes
  begin();
  EXPECT_EQ(p.setParm(2, "\"ABCDEFGHI\"", PARM_SRC_COMMANDLINE), KLP_RC_BAD_PARM);
  EXPECT_EQ(p.setParm(2, "ABCDEFGH\"", PARM_SRC_COMMANDLINE), KLP_RC_BAD_PARM);
  std::string out = end();
  EXPECT_NE(out.find("KLP0502E"), std::string::npos);
  EXPECT_NE(out.find("\"9\""), std::string::npos);  // effective length of the first
  EXPECT_STREQ(p.getParmString(2), "\"ABCDEFGH\"");

  // Two quotes alone: the value becomes empty and the source stays.
  EXPECT_EQ(p.setParm(2, "\"\"", PARM_SRC_SYSTEM), 0);
  EXPECT_STREQ(p.getParmString(2), "");
  EXPECT_EQ(p.getParmSource(2), PARM_SRC_COMMANDLINE);
  // A lone quote is an ordinary one-character text.
  EXPECT_EQ(p.setParm(2, "\"", PARM_SRC_SYSTEM), 0);
  EXPECT_STREQ(p.getParmString(2), "\"");

  // Setting a slot from its own text must not read freed memory.
  EXPECT_EQ(p.setParm(2, p.getParmString(2), PARM_SRC_SYSTEM), 0);
  EXPECT_STREQ(p.getParmString(2), "\"");
}

TEST_F(ParmTest, SetterRefusalsIssueTheirMessages) {
  auto t = smallTable();
  int rc = -1;
  klpParmClass p(t.data(), static_cast<int>(t.size()), &rc);
  p.setTableName("MYTABLE");
  begin();
  EXPECT_EQ(p.setParm(1, 101, PARM_SRC_COMMANDLINE), KLP_RC_BAD_PARM);  // 503
  EXPECT_EQ(p.setParm(1, 0, PARM_SRC_TABLE), KLP_RC_BAD_PARM);          // 541
  EXPECT_EQ(p.setParm(2, 5, PARM_SRC_COMMANDLINE), KLP_RC_BAD_PARM);    // 501
  EXPECT_EQ(p.setBool(4, 'x', PARM_SRC_COMMANDLINE), KLP_RC_BAD_PARM);  // 500
  EXPECT_EQ(p.setBool(4, '1', PARM_SRC_TABLE), KLP_RC_BAD_PARM);        // 541
  EXPECT_EQ(p.setCommand(1, 1, "x", PARM_SRC_COMMANDLINE), KLP_RC_BAD_PARM);  // 501
  std::string longText(1041, 'c');
  EXPECT_EQ(p.setCommand(3, 1, longText.c_str(), PARM_SRC_COMMANDLINE), KLP_RC_BAD_PARM);
  std::string out = end();
  const char* expected[] = {"KLP0503E", "KLP0541E", "KLP0501E", "KLP0500E", "KLP0541E",
                            "KLP0501E", "KLP0502E"};
  size_t at = 0;
  for (const char* id : expected) {
    at = out.find(id, at);
    ASSERT_NE(at, std::string::npos) << id << " missing in order in:\n" << out;
    ++at;
  }
  EXPECT_NE(out.find("MYTABLE"), std::string::npos);
  EXPECT_EQ(p.getParmInt(1), 42);
  EXPECT_EQ(p.getNamedCommand(), -1);
}

TEST_F(ParmTest, LogStdoutIsMirroredByEverySetterThatStoresIt) {
  auto t = smallTable();
  int rc = -1;
  klpParmClass p(t.data(), static_cast<int>(t.size()), &rc);
  ASSERT_EQ(logger_->getConsoleFlag(), 0);
  p.setParmBool(4, 1, PARM_SRC_COMMANDLINE);
  EXPECT_EQ(logger_->getConsoleFlag(), 1);
  p.setBool(4, 'n', PARM_SRC_COMMANDLINE);
  EXPECT_EQ(logger_->getConsoleFlag(), 0);
  p.setParmValue(4, "yes", PARM_SRC_CHGPARMS);
  EXPECT_EQ(logger_->getConsoleFlag(), 1);
  // Dropped by priority: the flag follows the stored value, not the request.
  p.setBool(4, 'N', PARM_SRC_COMMANDLINE);
  EXPECT_EQ(p.getParmBool(4), 1);
  EXPECT_EQ(logger_->getConsoleFlag(), 1);
}

TEST_F(ParmTest, SourceLabels) {
  EXPECT_STREQ(parmSourceLabel(0, "T"), "DEFAULT");
  EXPECT_STREQ(parmSourceLabel(1, "MY TABLE"), "MY TABLE");
  EXPECT_STREQ(parmSourceLabel(2, "T"), "COMMANDLINE");
  EXPECT_STREQ(parmSourceLabel(3, "T"), "CHGPARMS COMMAND");
  EXPECT_STREQ(parmSourceLabel(4, "T"), "SYSTEM OVERRIDE");
  EXPECT_STREQ(parmSourceLabel(5, "T"), "K APPLY OVERRIDE");
  EXPECT_STREQ(parmSourceLabel(6, "T"), "UNKNOWN");
  EXPECT_STREQ(parmSourceLabel(-1, "T"), "UNKNOWN");
  int rc = -1;
  auto t = smallTable();
  klpParmClass p(t.data(), static_cast<int>(t.size()), &rc);
  EXPECT_STREQ(p.getTableName(), "PARAMETERS TABLE");
}

TEST_F(ParmTest, ValueTextsAreValidatedByType) {
  auto t = smallTable();
  int rc = -1;
  klpParmClass p(t.data(), static_cast<int>(t.size()), &rc);
  EXPECT_TRUE(p.isValidValue(1, "42"));
  EXPECT_TRUE(p.isValidValue(1, "  +7"));
  EXPECT_FALSE(p.isValidValue(1, "7 "));
  EXPECT_FALSE(p.isValidValue(1, "4x"));
  EXPECT_FALSE(p.isValidValue(1, ""));
  EXPECT_FALSE(p.isValidValue(1, "-"));
  EXPECT_FALSE(p.isValidValue(1, "0"));    // below the minimum
  EXPECT_FALSE(p.isValidValue(1, "101"));  // above the maximum
  EXPECT_FALSE(p.isValidValue(1, "4294967297"));  // wraps to 1 in 32 bits
  EXPECT_TRUE(p.isValidValue(4, "yes"));
  EXPECT_TRUE(p.isValidValue(4, "n"));
  EXPECT_FALSE(p.isValidValue(4, "1"));
  EXPECT_FALSE(p.isValidValue(4, "YESS"));
  EXPECT_TRUE(p.isValidValue(2, "anything at all"));
  EXPECT_FALSE(p.isValidValue(2, std::string(1041, 'a').c_str()));
  EXPECT_FALSE(p.isValidValue(3, "x"));  // a COMMAND takes no value
}

TEST_F(ParmTest, PendingChangesHoldOneRecordPerParameter) {
  auto t = smallTable();
  int rc = -1;
  klpParmClass p(t.data(), static_cast<int>(t.size()), &rc);
  EXPECT_EQ(p.addChgParm(30, "1000"), 0);
  EXPECT_EQ(p.addChgParm(16, "200"), 0);
  EXPECT_EQ(p.addChgParm(30, "2000"), 0);
  EXPECT_EQ(p.getChgParmsCount(), 2);
  EXPECT_EQ(p.getChgParmsEntry(0)->index, 30);
  EXPECT_STREQ(p.getChgParmsEntry(0)->value, "2000");
  EXPECT_EQ(p.getChgParmsEntry(2)->index, -1);
  for (int i = 100; i < 162; ++i) ASSERT_EQ(p.addChgParm(i, "v"), 0);
  EXPECT_EQ(p.getChgParmsCount(), 64);
  begin();
  EXPECT_EQ(p.addChgParm(500, "v"), KLP_RC_BAD_PARM);
  std::string out = end();
  EXPECT_EQ(out, "cmdParmsClass ERROR: no find room in chgparms array\n");
  EXPECT_EQ(p.addChgParm(16, "300"), 0);  // an existing record still takes a new value
  EXPECT_EQ(p.getChgParmsEntry(64), nullptr);
}

// The exact bytes of a query message for a known registry.
TEST_F(ParmTest, QueryMessageBytes) {
  auto t = smallTable();
  int rc = -1;
  klpParmClass p(t.data(), static_cast<int>(t.size()), &rc);
  ASSERT_EQ(p.setParm(0, "DB1", PARM_SRC_COMMANDLINE), 0);
  ASSERT_EQ(p.setParmBool(4, 1, PARM_SRC_CHGPARMS), 0);
  // Included: 0 SERVER, 1 COUNT, 2 SCHEMA, 4 LOGSTDOUT (display 1); 5 never;
  // 6 only once it is set from somewhere.
  std::vector<uint8_t> expected = {4, 0, 'K', 'L', 'P', 'Q', 'R', 'Y', 'M', 'G'};
  auto record = [&](int source, const std::string& name, const std::string& value) {
    size_t len = 40 + value.size();
    expected.push_back(static_cast<uint8_t>(len));
    expected.push_back(static_cast<uint8_t>(len >> 8));
    expected.push_back(static_cast<uint8_t>(source));
    expected.push_back(0);
    expected.push_back(static_cast<uint8_t>(name.size()));
    expected.push_back(0);
    for (size_t i = 0; i < 32; ++i) expected.push_back(i < name.size() ? name[i] : 0);
    expected.push_back(static_cast<uint8_t>(value.size()));
    expected.push_back(0);
    expected.insert(expected.end(), value.begin(), value.end());
  };
  record(2, "SERVER", "DB1");
  record(0, "COUNT", "42");
  record(0, "SCHEMA", "KLP");
  record(3, "LOGSTDOUT", "Y");
  ASSERT_EQ(p.getQueryMsgSize(), expected.size());
  std::vector<uint8_t> msg(p.getQueryMsgSize(), 0xEE);
  ASSERT_EQ(p.setQueryMsg(msg.data()), 0);
  EXPECT_EQ(msg, expected);

  ASSERT_EQ(p.setParm(6, "\"v\"", PARM_SRC_TABLE), 0);
  EXPECT_EQ(p.getQueryMsgSize(), expected.size() + 40 + 3);

  // The round trip prints one 521 per record with its source label.
  msg.assign(p.getQueryMsgSize(), 0);
  p.setQueryMsg(msg.data());
  begin();
  rc = p.getQueryMsg(msg.data(), msg.size());
  std::string out = end();
  EXPECT_EQ(rc, 0);
  std::vector<std::string> lines;
  size_t pos = 0;
  while ((pos = out.find("KLP0521I", pos)) != std::string::npos) {
    size_t eol = out.find('\n', pos);
    lines.push_back(out.substr(pos, eol - pos));
    pos = eol;
  }
  ASSERT_EQ(lines.size(), 5u) << out;
  EXPECT_NE(lines[0].find("\"SERVER\" has the value \"DB1\" from \"COMMANDLINE\""),
            std::string::npos)
      << lines[0];
  EXPECT_NE(lines[3].find("\"LOGSTDOUT\" has the value \"Y\" from \"CHGPARMS COMMAND\""),
            std::string::npos);
  EXPECT_NE(lines[4].find("\"SOMETIMES\" has the value \"\"v\"\" from \"PARAMETERS TABLE\""),
            std::string::npos)
      << lines[4];
}

TEST_F(ParmTest, EmptySelectionIsTheBareHeader) {
  std::vector<ParmEntry> t = {strEntry(0, "A", 10, "", 0)};
  int rc = -1;
  klpParmClass p(t.data(), 1, &rc);
  EXPECT_EQ(p.getQueryMsgSize(), 10u);
  uint8_t msg[10];
  p.setQueryMsg(msg);
  EXPECT_EQ(memcmp(msg, "\0\0KLPQRYMG", 10), 0);
  begin();
  EXPECT_EQ(p.getQueryMsg(msg, sizeof msg), 0);
  EXPECT_EQ(end(), "");
}

// A received message is trusted for nothing: every length is checked.
TEST_F(ParmTest, MalformedQueryMessagesEndWithAnError) {
  auto t = smallTable();
  int rc = -1;
  klpParmClass p(t.data(), static_cast<int>(t.size()), &rc);
  std::vector<uint8_t> good(p.getQueryMsgSize());
  p.setQueryMsg(good.data());

  auto check = [&](std::vector<uint8_t> m, size_t len, int expectedRc, size_t lines) {
    // An exact-size copy, so that a read past the end is caught by the
    // sanitizers.
    std::vector<uint8_t> exact(m.begin(), m.begin() + static_cast<long>(len));
    begin();
    int r = p.getQueryMsg(exact.data(), exact.size());
    std::string out = end();
    EXPECT_EQ(r, expectedRc);
    size_t n = 0;
    for (size_t pos = 0; (pos = out.find("KLP0521I", pos)) != std::string::npos; ++pos) ++n;
    EXPECT_EQ(n, lines);
  };
  check(good, good.size(), 0, 4);
  check(good, 9, KLP_RC_BAD_PARM, 0);               // shorter than the header
  check(good, good.size() - 1, KLP_RC_BAD_PARM, 3);  // last value cut short

  std::vector<uint8_t> m = good;
  m[0] = 5;  // one record more than there is
  check(m, m.size(), KLP_RC_BAD_PARM, 4);

  m = good;
  m[10] = 39;  // record length below 40 must not loop
  m[11] = 0;
  check(m, m.size(), KLP_RC_BAD_PARM, 0);
  m[10] = 0;  // a record length of 0 neither
  check(m, m.size(), KLP_RC_BAD_PARM, 0);

  m = good;
  m[14] = 33;  // name length beyond the 32 name bytes
  check(m, m.size(), KLP_RC_BAD_PARM, 0);

  m = good;
  m[48] = 0xFF;  // value length beyond the message
  m[49] = 0xFF;
  check(m, m.size(), KLP_RC_BAD_PARM, 0);

  m = good;
  m[10] = 0xFF;  // record length beyond the message
  m[11] = 0x7F;
  check(m, m.size(), KLP_RC_BAD_PARM, 0);

  // An unknown source prints "UNKNOWN".
  m = good;
  m[12] = 6;
  begin();
  EXPECT_EQ(p.getQueryMsg(m.data(), m.size()), 0);
  EXPECT_NE(end().find("from \"UNKNOWN\""), std::string::npos);

  EXPECT_EQ(p.getQueryMsg(nullptr, 0), KLP_RC_BAD_PARM);
}

TEST_F(ParmTest, PrintParmsShowsTheDisplayedParameters) {
  auto t = smallTable();
  int rc = -1;
  klpParmClass p(t.data(), static_cast<int>(t.size()), &rc);
  p.setParmBool(4, 1, PARM_SRC_COMMANDLINE);  // console on, so 529 is shown
  begin();
  p.printParms();
  std::string out = end();
  size_t n = 0;
  for (size_t pos = 0; (pos = out.find("KLP0529I", pos)) != std::string::npos; ++pos) ++n;
  EXPECT_EQ(n, 4u) << out;
  EXPECT_NE(out.find("\"COUNT\" is set to \"42\" from \"DEFAULT\""), std::string::npos) << out;
  EXPECT_EQ(out.find("HIDDEN"), std::string::npos);
}

TEST_F(ParmTest, CurrentRegistryFeedsTheLogger) {
  auto t = smallTable();
  int rc = -1;
  {
    klpParmClass p(t.data(), static_cast<int>(t.size()), &rc);
    klpSetCurrentParms(&p);
    EXPECT_EQ(klpGetCurrentParms(), &p);
  }
  // A registry that goes away stops being current.
  EXPECT_EQ(klpGetCurrentParms(), nullptr);
}

TEST(SchemaRule, QuotedKeepsCaseUnquotedIsUpperCased) {
  std::string out;
  ASSERT_TRUE(applySchemaRule("\"My_Schema\"", &out));
  EXPECT_EQ(out, "My_Schema");
  ASSERT_TRUE(applySchemaRule("my_schema1", &out));
  EXPECT_EQ(out, "MY_SCHEMA1");
  out = "unchanged";
  EXPECT_FALSE(applySchemaRule("my-schema", &out));
  EXPECT_FALSE(applySchemaRule("\"my schema\"", &out));
  EXPECT_FALSE(applySchemaRule("\"abc", &out));
  EXPECT_EQ(out, "unchanged");
}

TEST(SchemaRule, MultibyteValuesUnderTheUsersLocale) {
  const char* old = getenv("LC_ALL");
  std::string saved = old ? old : "";
  setenv("LC_ALL", "C.UTF-8", 1);
  std::string out;
  EXPECT_TRUE(applySchemaRule("\xc3\xbc" "ber", &out));  // "über"
  EXPECT_EQ(out, "\xc3\x9c" "BER");
  EXPECT_TRUE(applySchemaRule("\"\xc3\xbc" "ber\"", &out));
  EXPECT_EQ(out, "\xc3\xbc" "ber");
  EXPECT_FALSE(applySchemaRule("\xff\xfe", &out));        // not UTF-8
  EXPECT_FALSE(applySchemaRule("\xc3\xbc-x", &out));      // "-" still refused
  EXPECT_FALSE(applySchemaRule("\xe2\x82\xac", &out));    // a symbol, not a letter
  if (old)
    setenv("LC_ALL", saved.c_str(), 1);
  else
    unsetenv("LC_ALL");
  // The caller's locale is untouched.
  EXPECT_STREQ(setlocale(LC_CTYPE, nullptr), "C");
}

}  // namespace
