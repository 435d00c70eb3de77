// Registry rules that can really break: table checks, source priority,
// quoted strings, type checks, LOGSTDOUT mirroring, the query message bytes
// and the parsing of a query message received from another process.
#include <gtest/gtest.h>

#include <clocale>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "common/msg/msglogger.h"
#include "common/parms/klpparm.h"
#include "common/parms/parmutil.h"
#include "common/util/klprc.h"
#include "tests/testing/klptest.h"

namespace {

ParmEntry intEntry(int index, const char* name, int lo, int hi, int def) {
  return makeParmEntry(index, name, 0, PARM_INTEGER, lo, hi, def, nullptr, 0, 1, 0);
}
ParmEntry strEntry(int index, const char* name, int max, const char* def, int display = 1) {
  return makeParmEntry(index, name, 0, PARM_STRING, -1, max, -1, def, 0, display, 0);
}

// A small registry with one parameter of each kind; index 4 is LOGSTDOUT.
std::vector<ParmEntry> smallTable() {
  return {strEntry(0, "SERVER", 40, ""),
          intEntry(1, "COUNT", 1, 100, 42),
          strEntry(2, "SCHEMA", 8, "KLP"),
          makeParmEntry(3, "GO", 0, PARM_COMMAND, -1, -1, -1, nullptr, 0, 0, 0),
          makeParmEntry(4, "LOGSTDOUT", 0, PARM_BOOLEAN, -1, -1, -1, nullptr, 0, 1, 0),
          strEntry(5, "HIDDEN", 10, "x", 0),
          strEntry(6, "SOMETIMES", 10, "", -1)};
}

size_t countOf(const std::string& text, const char* what) {
  size_t n = 0;
  for (size_t p = text.find(what); p != std::string::npos; p = text.find(what, p + 1)) ++n;
  return n;
}

// A process logger and the small registry, with stdout captured on demand.
class ParmTest : public ::testing::Test {
 protected:
  void SetUp() override {
    logger_ = std::make_unique<klptest::ProcessLogger>();
    auto t = smallTable();
    int rc = -1;
    p_ = std::make_unique<klpParmClass>(t.data(), static_cast<int>(t.size()), &rc);
    ASSERT_EQ(rc, 0);
  }
  void TearDown() override {
    klpSetCurrentParms(nullptr);
    p_.reset();
    logger_.reset();
  }
  static void begin() {
    fflush(stdout);
    ::testing::internal::CaptureStdout();
  }
  static std::string end() {
    fflush(stdout);
    return ::testing::internal::GetCapturedStdout();
  }
  std::unique_ptr<klptest::ProcessLogger> logger_;
  std::unique_ptr<klpParmClass> p_;
};

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
  std::string tooLong(1041, 'v');
  std::vector<ParmEntry> t = {intEntry(0, "GOOD", 0, 9, 5), longName,
                              intEntry(2, "LOWDEFAULT", 10, 20, 3), strEntry(6, "FAR", 10, ""),
                              strEntry(3, "LONGDEFAULT", 2000, tooLong.c_str())};
  begin();
  klpParmClass bad(t.data(), static_cast<int>(t.size()), &rc);
  out = end();
  EXPECT_EQ(rc, KLP_RC_BAD_PARM);
  for (const std::string& line :
       {"klpParmClass: Error: length of parameter name " + std::string(33, 'N') +
            " is greater than max (32).\n",
        std::string("klpParmClass: Error: default value (3) for parameter LOWDEFAULT is out "
                    "of range (10-20)\n"),
        std::string("klpParmClass: Error: parameter index (6) for parameter FAR is out of "
                    "range (0-5).\n"),
        "klpParmClass: Error: length of parameter value " + tooLong +
            " for parameter LONGDEFAULT is greater than max (1040)\n"})
    EXPECT_NE(out.find(line), std::string::npos) << line;
  EXPECT_EQ(bad.getParmInt(0), 5);
  begin();
  EXPECT_EQ(bad.getParmType(1), PARM_PLACEHOLDER);
  EXPECT_STREQ(bad.getParmName(3), "KLPPLACEHOLDER");
  end();

  // An index equal to the count is stored but not readable.
  t = {intEntry(0, "A", 0, 9, 1), intEntry(2, "C", 0, 9, 7)};
  klpParmClass p(t.data(), 2, &rc);
  EXPECT_EQ(rc, 0);
  begin();
  EXPECT_EQ(p.getParmInt(2), -1);
  EXPECT_EQ(p.setParm(2, 3, PARM_SRC_COMMANDLINE), KLP_RC_BAD_PARM);
  EXPECT_EQ(end(), "Parameter index 2 is out of range.\nParameter index 2 is out of range.\n");
  // With 64 entries an index of 64 has no slot to go to: refused.
  big.resize(63);
  big.push_back(intEntry(64, "EDGE", 0, 9, 0));
  begin();
  klpParmClass edge(big.data(), 64, &rc);
  out = end();
  EXPECT_EQ(rc, KLP_RC_BAD_PARM);
  EXPECT_NE(out.find("parameter index (64) for parameter EDGE is out of range (0-64)"),
            std::string::npos);
}

TEST_F(ParmTest, GettersOfTheWrongTypeAnswerTheirFailureValue) {
  klpParmClass& p = *p_;
  begin();
  EXPECT_EQ(p.getParmInt(2), -1);
  EXPECT_EQ(p.getParmBool(1), 0);
  EXPECT_EQ(p.getParmString(4), nullptr);
  EXPECT_EQ(p.getParmString(3), nullptr);  // a COMMAND is not a STRING
  EXPECT_EQ(p.getParmType(-1), -1);
  EXPECT_EQ(p.getParmSource(7), -1);
  EXPECT_EQ(p.getParmName(64), nullptr);
  EXPECT_EQ(end(),
            "Parameter index 2 is not of type INTEGER.\n"
            "Parameter index 1 is not of type BOOLEAN.\n"
            "Parameter index 4 is not of type STRING.\n"
            "Parameter index 3 is not of type STRING.\n"
            "Parameter index -1 is out of range.\n"
            "Parameter index 7 is out of range.\n"
            "Parameter index 64 is out of range.\n");
}

// Priority, and LOGSTDOUT mirrored by every setter that stores it.
TEST_F(ParmTest, HigherSourcesAreNeverReplacedByLowerOnes) {
  klpParmClass& p = *p_;
  EXPECT_EQ(p.setParm(1, 10, PARM_SRC_CHGPARMS), 0);
  EXPECT_EQ(p.setParm(1, 20, PARM_SRC_COMMANDLINE), 0);  // dropped, still 0
  EXPECT_EQ(p.getParmInt(1), 10);
  EXPECT_EQ(p.getParmSource(1), PARM_SRC_CHGPARMS);
  EXPECT_EQ(p.setParm(1, 30, PARM_SRC_KAPPLY), 0);
  EXPECT_EQ(p.getParmInt(1), 30);
  EXPECT_EQ(p.setParm(2, "ABC", PARM_SRC_SYSTEM), 0);
  EXPECT_EQ(p.setParm(2, "XYZ", PARM_SRC_COMMANDLINE), 0);
  EXPECT_STREQ(p.getParmString(2), "ABC");

  ASSERT_EQ(logger_->get()->getConsoleFlag(), 0);
  p.setParmBool(4, 1, PARM_SRC_COMMANDLINE);
  EXPECT_EQ(logger_->get()->getConsoleFlag(), 1);
  p.setBool(4, 'n', PARM_SRC_COMMANDLINE);
  EXPECT_EQ(logger_->get()->getConsoleFlag(), 0);
  p.setParmValue(4, "yes", PARM_SRC_CHGPARMS);
  EXPECT_EQ(logger_->get()->getConsoleFlag(), 1);
  // Dropped by priority: the flag follows the stored value, not the request.
  EXPECT_EQ(p.setBool(4, 'N', PARM_SRC_COMMANDLINE), 0);
  EXPECT_EQ(p.setParmBool(4, 0, PARM_SRC_TABLE), 0);
  EXPECT_EQ(p.getParmBool(4), 1);
  EXPECT_EQ(logger_->get()->getConsoleFlag(), 1);

  // A command ignores priority.
  EXPECT_EQ(p.setCommand(3, 1, "first", PARM_SRC_KAPPLY), 0);
  EXPECT_EQ(p.setCommand(3, 1, "second", PARM_SRC_DEFAULT), 0);
  EXPECT_STREQ(p.getCommandText(3), "second");
  EXPECT_EQ(p.getParmSource(3), PARM_SRC_DEFAULT);
  EXPECT_EQ(p.getNamedCommand(), 3);
}

TEST_F(ParmTest, QuotedStringsCountWithoutTheirQuotes) {
  klpParmClass& p = *p_;
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
  // A lone quote is an ordinary one-character text; setting a slot from its
  // own text must not read freed memory.
  EXPECT_EQ(p.setParm(2, "\"", PARM_SRC_SYSTEM), 0);
  EXPECT_EQ(p.setParm(2, p.getParmString(2), PARM_SRC_SYSTEM), 0);
  EXPECT_STREQ(p.getParmString(2), "\"");
}

TEST_F(ParmTest, SetterRefusalsIssueTheirMessages) {
  klpParmClass& p = *p_;
  p.setTableName("MYTABLE");
  std::string longText(1041, 'c');
  begin();
  EXPECT_EQ(p.setParm(1, 101, PARM_SRC_COMMANDLINE), KLP_RC_BAD_PARM);  // 503
  EXPECT_EQ(p.setParm(1, 0, PARM_SRC_TABLE), KLP_RC_BAD_PARM);          // 541
  EXPECT_EQ(p.setParm(2, 5, PARM_SRC_COMMANDLINE), KLP_RC_BAD_PARM);    // 501
  EXPECT_EQ(p.setBool(4, 'x', PARM_SRC_COMMANDLINE), KLP_RC_BAD_PARM);  // 500
  EXPECT_EQ(p.setBool(4, '1', PARM_SRC_TABLE), KLP_RC_BAD_PARM);        // 541
  EXPECT_EQ(p.setCommand(1, 1, "x", PARM_SRC_COMMANDLINE), KLP_RC_BAD_PARM);  // 501
  EXPECT_EQ(p.setCommand(3, 1, longText.c_str(), PARM_SRC_COMMANDLINE), KLP_RC_BAD_PARM);
  std::string out = end();
  size_t at = 0;
  for (const char* id : {"KLP0503E", "KLP0541E", "KLP0501E", "KLP0500E", "KLP0541E",
                         "KLP0501E", "KLP0502E"}) {
    at = out.find(id, at);
    ASSERT_NE(at, std::string::npos) << id << " missing in order in:\n" << out;
    ++at;
  }
  EXPECT_NE(out.find("MYTABLE"), std::string::npos);
  EXPECT_EQ(p.getParmInt(1), 42);
  EXPECT_EQ(p.getNamedCommand(), -1);
}

TEST_F(ParmTest, SourceLabelsAndValueTexts) {
  const char* labels[] = {"DEFAULT", "MY TABLE", "COMMANDLINE", "CHGPARMS COMMAND",
                          "SYSTEM OVERRIDE", "K APPLY OVERRIDE", "UNKNOWN"};
  for (int s = 0; s < 7; ++s) EXPECT_STREQ(parmSourceLabel(s, "MY TABLE"), labels[s]) << s;
  EXPECT_STREQ(parmSourceLabel(-1, "T"), "UNKNOWN");

  struct {
    int index;
    const char* text;
    bool ok;
  } cases[] = {{1, "42", true},     {1, "  +7", true}, {1, "7 ", false}, {1, "4x", false},
               {1, "", false},      {1, "-", false},   {1, "0", false},  {1, "101", false},
               {1, "4294967297", false},  // wraps to 1 in 32 bits
               {4, "yes", true},    {4, "n", true},    {4, "1", false},  {4, "YESS", false},
               {2, "anything at all", true}, {3, "x", false}};  // a COMMAND takes no value
  for (const auto& c : cases) EXPECT_EQ(p_->isValidValue(c.index, c.text), c.ok) << c.text;
  EXPECT_FALSE(p_->isValidValue(2, std::string(1041, 'a').c_str()));
}

TEST_F(ParmTest, PendingChangesHoldOneRecordPerParameter) {
  klpParmClass& p = *p_;
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
  EXPECT_EQ(end(), "cmdParmsClass ERROR: no find room in chgparms array\n");
  EXPECT_EQ(p.addChgParm(16, "300"), 0);  // an existing record still takes a new value
  EXPECT_EQ(p.getChgParmsEntry(64), nullptr);
}

// The exact bytes of a query message for a known registry, and its printout.
TEST_F(ParmTest, QueryMessageBytes) {
  klpParmClass& p = *p_;
  ASSERT_EQ(p.setParm(0, "DB1", PARM_SRC_COMMANDLINE), 0);
  ASSERT_EQ(p.setParmBool(4, 1, PARM_SRC_CHGPARMS), 0);
  // Included: 0 SERVER, 1 COUNT, 2 SCHEMA, 4 LOGSTDOUT (display 1); 5 never;
  // 6 only once it is set from somewhere.
  std::vector<uint8_t> expected = {4, 0, 'K', 'L', 'P', 'Q', 'R', 'Y', 'M', 'G'};
  auto record = [&](int source, const std::string& name, const std::string& value) {
    size_t len = 40 + value.size();
    expected.insert(expected.end(), {static_cast<uint8_t>(len), static_cast<uint8_t>(len >> 8),
                                     static_cast<uint8_t>(source), 0,
                                     static_cast<uint8_t>(name.size()), 0});
    for (size_t i = 0; i < 32; ++i) expected.push_back(i < name.size() ? name[i] : 0);
    expected.insert(expected.end(), {static_cast<uint8_t>(value.size()), 0});
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
  EXPECT_EQ(p.getQueryMsg(msg.data(), msg.size()), 0);
  std::string out = end();
  std::vector<std::string> lines;
  for (size_t pos = 0; (pos = out.find("KLP0521I", pos)) != std::string::npos;) {
    size_t eol = out.find('\n', pos);
    lines.push_back(out.substr(pos, eol - pos));
    pos = eol;
  }
  ASSERT_EQ(lines.size(), 5u) << out;
  EXPECT_NE(lines[0].find("\"SERVER\" has the value \"DB1\" from \"COMMANDLINE\""),
            std::string::npos) << lines[0];
  EXPECT_NE(lines[3].find("\"LOGSTDOUT\" has the value \"Y\" from \"CHGPARMS COMMAND\""),
            std::string::npos) << lines[3];
  EXPECT_NE(lines[4].find("\"SOMETIMES\" has the value \"\"v\"\" from \"PARAMETERS TABLE\""),
            std::string::npos) << lines[4];

  // An empty selection is the bare header.
  std::vector<ParmEntry> t = {strEntry(0, "A", 10, "", 0)};
  int rc = -1;
  klpParmClass none(t.data(), 1, &rc);
  ASSERT_EQ(none.getQueryMsgSize(), 10u);
  uint8_t head[10];
  none.setQueryMsg(head);
  EXPECT_EQ(memcmp(head, "\0\0KLPQRYMG", 10), 0);
  begin();
  EXPECT_EQ(none.getQueryMsg(head, sizeof head), 0);
  EXPECT_EQ(end(), "");
}

// A received message is trusted for nothing: every length is checked.
TEST_F(ParmTest, MalformedQueryMessagesEndWithAnError) {
  klpParmClass& p = *p_;
  std::vector<uint8_t> good(p.getQueryMsgSize());
  p.setQueryMsg(good.data());

  auto check = [&](const std::vector<uint8_t>& m, size_t len, int expectedRc, size_t lines) {
    // An exact-size copy, so that a read past the end is caught by the
    // sanitizers.
    std::vector<uint8_t> exact(m.begin(), m.begin() + static_cast<long>(len));
    begin();
    EXPECT_EQ(p.getQueryMsg(exact.data(), exact.size()), expectedRc);
    EXPECT_EQ(countOf(end(), "KLP0521I"), lines);
  };
  auto patched = [&](std::initializer_list<std::pair<size_t, uint8_t>> bytes) {
    std::vector<uint8_t> m = good;
    for (auto [at, value] : bytes) m[at] = value;
    return m;
  };
  check(good, good.size(), 0, 4);
  check(good, 9, KLP_RC_BAD_PARM, 0);                // shorter than the header
  check(good, good.size() - 1, KLP_RC_BAD_PARM, 3);  // last value cut short
  check(patched({{0, 5}}), good.size(), KLP_RC_BAD_PARM, 4);  // one record more than there is
  for (auto m : {patched({{10, 39}, {11, 0}}),      // record length below 40 must not loop
                 patched({{10, 0}, {11, 0}}),       // a record length of 0 neither
                 patched({{14, 33}}),               // name length beyond the 32 name bytes
                 patched({{48, 0xFF}, {49, 0xFF}}),   // value length beyond the message
                 patched({{10, 0xFF}, {11, 0x7F}})})  // record length beyond the message
    check(m, m.size(), KLP_RC_BAD_PARM, 0);

  // An unknown source prints "UNKNOWN".
  auto m = patched({{12, 6}});
  begin();
  EXPECT_EQ(p.getQueryMsg(m.data(), m.size()), 0);
  EXPECT_NE(end().find("from \"UNKNOWN\""), std::string::npos);
  EXPECT_EQ(p.getQueryMsg(nullptr, 0), KLP_RC_BAD_PARM);
}

TEST_F(ParmTest, PrintParmsShowsTheDisplayedParameters) {
  p_->setParmBool(4, 1, PARM_SRC_COMMANDLINE);  // console on, so 529 is shown
  begin();
  p_->printParms();
  std::string out = end();
  EXPECT_EQ(countOf(out, "KLP0529I"), 4u) << out;
  EXPECT_NE(out.find("\"COUNT\" is set to \"42\" from \"DEFAULT\""), std::string::npos) << out;
  EXPECT_EQ(out.find("HIDDEN"), std::string::npos);
}

TEST_F(ParmTest, CurrentRegistryFeedsTheLogger) {
  klpSetCurrentParms(p_.get());
  EXPECT_EQ(klpGetCurrentParms(), p_.get());
  p_.reset();  // a registry that goes away stops being current
  EXPECT_EQ(klpGetCurrentParms(), nullptr);
}

TEST(SchemaRule, QuotedKeepsCaseUnquotedIsUpperCased) {
  std::string out;
  ASSERT_TRUE(applySchemaRule("\"My_Schema\"", &out));
  EXPECT_EQ(out, "My_Schema");
  ASSERT_TRUE(applySchemaRule("my_schema1", &out));
  EXPECT_EQ(out, "MY_SCHEMA1");
  out = "unchanged";
  for (const char* bad : {"my-schema", "\"my schema\"", "\"abc"})
    EXPECT_FALSE(applySchemaRule(bad, &out)) << bad;
  EXPECT_EQ(out, "unchanged");

  // Multibyte values under the user's locale.
  const char* old = getenv("LC_ALL");
  std::string saved = old ? old : "";
  setenv("LC_ALL", "C.UTF-8", 1);
  EXPECT_TRUE(applySchemaRule("\xc3\xbc" "ber", &out));  // "über"
  EXPECT_EQ(out, "\xc3\x9c" "BER");
  EXPECT_TRUE(applySchemaRule("\"\xc3\xbc" "ber\"", &out));
  EXPECT_EQ(out, "\xc3\xbc" "ber");
  EXPECT_FALSE(applySchemaRule("\xff\xfe", &out));      // not UTF-8
  EXPECT_FALSE(applySchemaRule("\xc3\xbc-x", &out));    // "-" still refused
  EXPECT_FALSE(applySchemaRule("\xe2\x82\xac", &out));  // a symbol, not a letter
  old ? setenv("LC_ALL", saved.c_str(), 1) : unsetenv("LC_ALL");
  // The caller's locale is untouched.
  EXPECT_STREQ(setlocale(LC_CTYPE, nullptr), "C");
}

}  // namespace
