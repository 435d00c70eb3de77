// Composition of message texts: built-in table, header values, bounds, markers.
#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <vector>

#include "common/msg/msglogger.h"

namespace {

// The plain logger has no catalogue: texts come from the table only.
struct TextTest : ::testing::Test {
  msgLogger logger{MSG_APP_KLPKCCMD, 0};
  void SetUp() override {
    logger.loadBuiltinMsgs(builtinMsgTable);
    logger.setProgramQualifier("KLP");
  }
  std::string text(int number, const char* v1 = nullptr, const char* v2 = nullptr) {
    char buf[2048];
    logger.getKlpMsgText(number, "test", "T", buf, sizeof buf, v1, v2);
    return buf;
  }
  // The values putKlpMsg stores (nine, missing ones "*") joined by "|", or
  // with `lengths` their lengths joined by " ".
  std::string values(int number, std::vector<const char*> v, bool lengths = false) {
    logMsg* r = msgNewRecord(number, 0, "test", "T");
    v.resize(MSG_MAX_VALUES);
    logger.setMsgValues(r, MSG_MAX_VALUES, v.data());
    std::string out;
    for (int i = 0; i < r->valueCount; ++i)
      out += (i ? (lengths ? " " : "|") : "") +
             (lengths ? std::to_string(strlen(r->values[i])) : r->values[i]);
    msgFreeRecord(r);
    return out;
  }
};

TEST(BuiltinTable, LoadsWellFormedRowsOnceAndTheFirstDefinitionWins) {
  msgLogger l(MSG_APP_KLPKCCMD, 0);
  EXPECT_EQ(116, l.loadBuiltinMsgs(builtinMsgTable));
  EXPECT_EQ(0, l.loadBuiltinMsgs(builtinMsgTable));
  EXPECT_EQ(0, l.loadBuiltinMsgs(builtinMsgTable + 116) + l.loadBuiltinMsgs(nullptr) + l.addBuiltinMsg(nullptr));
  const std::pair<const char*, int> rows[] = {
      {"KLP0000D zero", 0}, {"KLP9999D too big", 0}, {"XYZ8100D not ours", 0}, {"KLP81", 0},
      {"KLP8a00D", 0},      {"KLP8100D first", 1},   {"KLP8100D second", 0},   {"KLP8200D other", 1},
      {"KLP0001D low", 1},  {"KLP9998D high", 1}};  // 8200 shares the bucket of 8100
  for (auto [row, added] : rows) EXPECT_EQ(added, l.addBuiltinMsg(row)) << row;
  logMsg* r = msgNewRecord(0, 0, "o", "T");
  for (auto [number, found] : {std::pair{8100, "KLP8100D first"}, {8200, "KLP8200D other"},
                               {1, "KLP0001D low"}, {9998, "KLP9998D high"}, {8300, ""},
                               {-1, ""}, {-100, ""}, {10000, ""}}) {
    r->text[0] = '\0';
    EXPECT_EQ(found[0] != '\0', l.lookupBuiltinMsg(number, 1024, r)) << number;
    EXPECT_STREQ(found, r->text);
  }
  msgFreeRecord(r);
}

TEST_F(TextTest, TextsComposeFromTheirRowsValuesAndHeaderValues) {
  const struct { int number; const char *v1, *v2, *want; } rows[] = {
      {8999, "Message logging re-enabled", nullptr, "KLP8999D Message logging re-enabled"},
      {8006, "X", nullptr, "KLP8006D  \"KlpKCcmd\" : \"KLP\" : \"T\" : Element \"X\" is out of range."},
      {8000, "E", "L", "KLP8000D  \"KlpKCcmd\" : \"KLP\" : \"T\" : List element named \"E\" is "
                       "invalidly chainedon list named \"L\"."},
      {8005, "", nullptr, "KLP8005D  \"KlpKCcmd\" : \"KLP\" : \"T\" : Thread \"*\" is in un-expected "
                          "state \"*\"."},
      {661, "X", nullptr, "KLP0661E Job was cancelled"},
      {9011, "x", nullptr, "KLP7654E  \"KlpKCcmd\" : \"KLP\" : \"T\" : The autostop and applyupto "
                           "parameters cannot be specified at the same time when operating the K "
                           "Apply program. "},
      {600, "A", "B", "KLP0553W  \"KlpKCcmd\" : \"KLP\" : \"T\" : An internal error  \"4\" occurred "
                      "for message number \"600\" containing \"9\" substitution fields: "
                      "\"KlpKCcmd\", \"KLP\" : \"T\", \"A\", \"B\", \"*\", \"*\", \"*\", \"*\", \"*\""},
      // Negative numbers are outside the table, never an out-of-range bucket.
      {-7, "A", nullptr, "KLP0553W  \"KlpKCcmd\" : \"KLP\" : \"T\" : An internal error  \"4\" "
                         "occurred for message number \"-7\" containing \"9\" substitution fields: "
                         "\"A\", \"*\", \"*\", \"*\", \"*\", \"*\", \"*\", \"*\", \"*\""},
      // Control characters in values are written escaped: a value from
      // another process must not end or split the line it is written on.
      {8999, "Q1\nKLP0522I forged\r\t", nullptr, "KLP8999D Q1\\nKLP0522I forged\\r\\t"},
      {8999, "\x1b[31mred\x7f\x01", nullptr, "KLP8999D \\x1B[31mred\\x7F\\x01"},
      {8999, "back\\slash \xc3\xbc", nullptr, "KLP8999D back\\slash \xc3\xbc"},
  };
  for (const auto& r : rows) EXPECT_EQ(r.want, text(r.number, r.v1, r.v2)) << r.number;
  logger.setProgramQualifier("K\nLP");
  EXPECT_EQ("KLP8006D  \"KlpKCcmd\" : \"K\\nLP\" : \"T\" : Element \"X\" is out of range.", text(8006, "X"));
  logger.setProgramQualifier(std::string(200, 'Q').c_str());
  EXPECT_EQ(std::string(128, 'Q'), logger.getProgramQualifier());
  std::string names;
  for (int i = -1; i <= MSG_APPLICATION_COUNT; ++i) names += msgApplicationName(i) + std::string("|");
  EXPECT_EQ("|@A|Capture|Apply|KlpCcmd|KlpAcmd|K Capture|K Apply|Klpmon|Klppwd|KlpMcmd|KlpKCcmd|"
            "KlpKAcmd|KlpTDiff|KlpKMFmt|Analyzer|K Analyzer|KlpSList|KlpTRep||", names);
}

TEST_F(TextTest, HeaderValuesFollowTheNumberRangesAndPushOutTheLastCallerValues) {
  const std::string none = "1|2|3|4|5|6|7|8|9", qt = "KLP\" : \"T|1|2|3|4|5|6|7|8",
                    app = "KlpKCcmd|KLP\" : \"T|1|2|3|4|5|6|7";
  const std::pair<int, const std::string*> rows[] = {
      {0, &qt},      {499, &qt},    {500, &app},   {999, &app},   {1000, &qt},   {1499, &qt},
      {1500, &none}, {1975, &none}, {1976, &app},  {1999, &app},  {2000, &none}, {3999, &none},
      {4000, &app},  {4099, &app},  {4100, &none}, {5099, &none}, {5100, &qt},   {5199, &qt},
      {5200, &none}, {6999, &none}, {7000, &app},  {8997, &app},  {8998, &none}, {-1, &none}};
  for (auto [number, want] : rows)
    EXPECT_EQ(*want, values(number, {"1", "2", "3", "4", "5", "6", "7", "8", "9"})) << number;
}

// The sum of the values is bounded by 1161: 1161 / 9 = 129 is the share, and
// only values longer than it lose the same number of characters.
TEST_F(TextTest, ValueLengthBoundCutsLongValuesEvenly) {
  std::string v200(200, 'v'), v1000(1000, 'w'), v129(129, 's'), v130(130, 'm'), huge(20000, 'h');
  const char *p = v200.c_str(), *w = v1000.c_str(), *m = v130.c_str();
  EXPECT_EQ("129 129 129 129 129 129 129 129 129", values(8999, {p, p, p, p, p, p, p, p, p}, true));
  // 1800 over 9: excess 639, each loses 71; 2135 over two long values: 487 each.
  EXPECT_EQ("129 513 513 1 1 1 1 1 1",
            values(8999, {v129.c_str(), w, w, "a", "b", "c", "d", "e", "f"}, true));
  // The even cut (19879 / 9 = 2208) exceeds what the 130-character ones hold:
  // they are emptied, never cut below nothing.
  EXPECT_EQ("0 0 0 0 0 0 0 0 17792", values(8999, {m, m, m, m, m, m, m, m, huge.c_str()}, true));
}

TEST(Substitution, FollowsMarkerOrder) {
  char* values[3] = {const_cast<char*>("A"), const_cast<char*>(""), const_cast<char*>("$3")};
  const struct { const char* tmpl; int count, cap; const char* want; } rows[] = {
      {"<$1|$2|$3>", 3, 127, "<A|*|$3>"},         {"no markers", 3, 127, "no markers"},
      {"$2 $1", 3, 127, "$2 A"},                  // a marker before $1 stays
      {"$1 $1 $2", 3, 127, "A $1 *"},             // replaced at its first place only
      {"$1 $2 $3 $5 $4", 3, 127, "A * $3 $5 *"},  // the value "$3" is not searched
      {"$1 $3 $2", 3, 127, "A $3 *"},             // stops at the first missing marker
      {"$1 $2 $3", 1, 127, "A * *"},              // values beyond the count are "*"
      {"<$1|$2|$3>", 3, 3, "<A|"},   {"abcdef$1", 3, 4, "abcd"},  {"x$", 3, 127, "x$"}};
  for (const auto& r : rows) {
    char out[128];
    EXPECT_EQ(static_cast<int>(strlen(r.want)),
              msgSubstitute(r.tmpl, strlen(r.tmpl), values, r.count, out, r.cap));
    EXPECT_STREQ(r.want, out) << r.tmpl;
  }
}

TEST_F(TextTest, TextIsCutAt1024AndNeverWrittenPastTheBuffer) {
  std::string big(1100, 'z');
  logMsg* r = msgNewRecord(8999, 0, "t", "T");
  const char* v[MSG_MAX_VALUES] = {big.c_str()};
  logger.setMsgValues(r, MSG_MAX_VALUES, v);
  logger.composeKlpMsg(r);
  EXPECT_EQ("KLP8999D " + big.substr(0, 1015), r->text);
  msgFreeRecord(r);
  char buf[32];
  memset(buf, '#', sizeof buf);
  EXPECT_EQ(19, logger.getKlpMsgText(8006, "t", "T", buf, 20, "X"));
  EXPECT_EQ(0, logger.getKlpMsgText(8006, "t", "T", buf + 21, 0, "X"));  // untouched
  EXPECT_EQ(std::string("KLP8006D  \"KlpKCcmd\0", 20) + std::string(12, '#'), std::string(buf, 32));
}

TEST(LogBaseName, FormsDataSetAndPlainNames) {
  const struct { const char *path, *name; size_t room; const char* want; } rows[] = {  // "": none
      {"//HLQ", "MY_DB.KLP_X.KCAP", 64, "MYDB.KLPX.KCAP.LOG"}, {"//HLQ", "ONE.PART", 64, ""},
      {"//HLQ", "ABCDEFGHIJ.KLMNOPQRST.REST.MORE", 64, "ABCDEFGH.KLMNOPQR.REST.MORE.LOG"},
      {"/var/log/", "MYDB.KLP.KCAP", 64, "MYDB.KLP.KCAP.log"}, {"/x", "does-not-fit", 8, ""}};
  for (const auto& r : rows) {
    char out[64] = "junk";
    EXPECT_EQ(r.want[0] != '\0', msgLogBaseName(r.path, r.name, out, r.room)) << r.name;
    EXPECT_STREQ(r.want, out);
  }
}

}  // namespace
