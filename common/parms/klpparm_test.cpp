// The registry: table checks, setters, the command line, the query message made and parsed.
#include <gtest/gtest.h>
#include <unistd.h>

#include <clocale>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <memory>
#include <sstream>
#include <string>
#include <tuple>
#include <vector>

#include "common/msg/msglogger.h"
#include "common/parms/klpparm.h"
#include "common/util/klprc.h"
#include "tests/testing/klptest.h"

namespace {

using Records = std::vector<std::string>;

ParmEntry intEntry(int index, const char* name, int lo, int hi, int def) {
  return makeParmEntry(index, name, 0, PARM_INTEGER, lo, hi, def, nullptr, 0, 1, 1);
}
ParmEntry strEntry(int index, const char* name, int max, const char* def, int display = 1) {
  return makeParmEntry(index, name, 0, PARM_STRING, -1, max, -1, def, 0, display, 0);
}

// A slot as "value@source" (a COMMAND as "flag:text@source").
std::string state(const klpParmClass& p, int i) {
  const ParmEntry* s = p.peekSlot(i);
  std::string v = s->type == PARM_INTEGER   ? std::to_string(s->intValue)
                  : s->type == PARM_BOOLEAN ? std::to_string(s->boolValue)
                  : s->type == PARM_COMMAND ? std::to_string(s->boolValue) + ":" + s->strValue
                                            : s->strValue;
  return v + "@" + std::to_string(s->source);
}
std::string states(const klpParmClass& p, std::vector<int> slots = {0, 1, 2, 3, 4}) {
  std::string s;
  for (int i : slots) s += (s.empty() ? "" : " ") + state(p, i);
  return s;
}

// A current registry of each kind (8 matched by 5 characters), a UTF-8 locale, a private directory.
struct ParmTest : ::testing::Test {
  void SetUp() override {
    setenv("LC_ALL", "C.UTF-8", 1);
    ASSERT_EQ(chdir(dir_.path().c_str()), 0);
    fresh();
  }
  void TearDown() override { EXPECT_EQ(chdir(cwd_.c_str()), 0); }
  void fresh() {
    const ParmEntry t[9] = {
        strEntry(0, "SERVER", 40, ""), intEntry(1, "COUNT", 1, 100, 42), strEntry(2, "SCHEMA", 8, "KLP"),
        makeParmEntry(3, "GO", 0, PARM_COMMAND, -1, -1, -1, nullptr, 0, 0, 0),
        makeParmEntry(4, "LOGSTDOUT", 0, PARM_BOOLEAN, -1, -1, -1, nullptr, 0, 1, 1),
        strEntry(5, "SOMETIMES", 10, "", -1), strEntry(6, "PWDFILE", 1040, "", 0),
        strEntry(7, "PATH", 1040, "", 0), makeParmEntry(8, "LIMIT_COUNT", 5, PARM_INTEGER, 0, 9, 0, nullptr, 0, 0, 1)};
    int rc = -1;
    p_ = std::make_unique<klpParmClass>(t, 9, &rc);
    ASSERT_EQ(rc, 0);
    p_->setTableName("MYTABLE");
    p_->setUsageText("usage\n");
    klpSetCurrentParms(p_.get());
    log_.get()->setConsoleFlag(0);
    log_.take();
  }
  // processCommandLine over "prog" and args, or getPositionalDBName into `leading`.
  int parse(std::vector<std::string> args, const char* sid = nullptr, std::string* leading = nullptr) {
    if (!leading) args.insert(args.begin(), "prog");
    std::vector<char*> argv;
    for (auto& a : args) argv.push_back(a.data());
    sid && *sid ? setenv("ORACLE_SID", sid, 1) : unsetenv("ORACLE_SID");
    int consumed = -1, n = static_cast<int>(argv.size());
    if (!leading) return p_->processCommandLine(n, argv.data());
    int rc = p_->getPositionalDBName(n, argv.data(), &consumed);
    *leading = std::to_string(consumed) + " " + state(*p_, 0);
    return rc;
  }
  std::string cwd_ = std::filesystem::current_path().string();
  klptest::TmpDir dir_;
  klptest::ProcessLogger log_;
  std::unique_ptr<klpParmClass> p_;
};

TEST_F(ParmTest, ConstructorRefusesBadTablesAndGettersTheirMisuse) {
  // 65 entries: refused as a whole, nothing readable afterwards.
  std::vector<ParmEntry> big(65, intEntry(0, "P", 0, 9, 0));
  int rc = -5;
  std::unique_ptr<klpParmClass> p;
  auto make65 = [&] { p = std::make_unique<klpParmClass>(big.data(), 65, &rc); EXPECT_EQ(p->getParmInt(0), -1); };
  EXPECT_EQ(klptest::stdoutOf(make65), "klpParmClass: Error: parameter count (65) is out of range (0-64).\n"
                                       "Parameter index 0 is out of range.\n");
  EXPECT_EQ(rc, 0);
  // Bad entries are skipped, the good ones (at their bounds) still taken.
  ParmEntry longName = intEntry(1, "", 0, 9, 0);
  memset(longName.name, 'N', sizeof longName.name);  // 33 characters, no terminator
  const std::string v1040(1040, 'e'), v1041(1041, 'v');
  std::vector<ParmEntry> t = {intEntry(0, "GOOD", 0, 9, 5), longName, intEntry(2, "LOW", 10, 20, 9),
                              intEntry(3, "HIGH", 10, 20, 21), strEntry(10, "FAR", 10, ""),
                              strEntry(4, "LONG", 2000, v1041.c_str()), strEntry(5, "EDGE", 1040, v1040.c_str()),
                              intEntry(6, "BOTTOM", 10, 20, 10), intEntry(7, "TOP", 10, 20, 20)};
  EXPECT_EQ(klptest::stdoutOf([&] { p = std::make_unique<klpParmClass>(t.data(), 9, &rc); }),
            "klpParmClass: Error: length of parameter name " + std::string(33, 'N') + " is greater than max (32).\n"
                "klpParmClass: Error: default value (9) for parameter LOW is out of range (10-20)\n"
                "klpParmClass: Error: default value (21) for parameter HIGH is out of range (10-20)\n"
                "klpParmClass: Error: parameter index (10) for parameter FAR is out of range (0-9).\n"
                "klpParmClass: Error: length of parameter value " + v1041 +
                " for parameter LONG is greater than max (1040)\n");
  EXPECT_EQ(rc, KLP_RC_BAD_PARM);
  EXPECT_EQ(state(*p, 0) + state(*p, 6) + state(*p, 7) + state(*p, 5), "5@010@020@0" + v1040 + "@0");
  for (int refused : {1, 2, 3, 4}) EXPECT_STREQ(p->peekSlot(refused)->name, "KLPPLACEHOLDER");
  // Getters of the wrong type or outside the count (an index equal to it is stored, unreadable).
  t = {intEntry(0, "A", 0, 9, 1), intEntry(2, "C", 0, 9, 7)};
  p = std::make_unique<klpParmClass>(t.data(), 2, &rc);
  EXPECT_EQ(klptest::stdoutOf([&] {
              std::vector<bool> refused = {p_->getParmInt(2) == -1, p_->getParmBool(1) == 0, !p_->getParmString(4),
                                           !p_->getParmString(3), p_->getParmType(-1) == -1, !p_->getParmName(9),
                                           p->getParmSource(2) == -1, p->setParm(2, 3, PARM_SRC_COMMANDLINE) == 2002};
              EXPECT_EQ(refused, std::vector<bool>(8, true));  // in order; a COMMAND is no STRING
            }),
            "Parameter index 2 is not of type INTEGER.\nParameter index 1 is not of type BOOLEAN.\n"
            "Parameter index 4 is not of type STRING.\nParameter index 3 is not of type STRING.\n"
            "Parameter index -1 is out of range.\nParameter index 9 is out of range.\n"
            "Parameter index 2 is out of range.\nParameter index 2 is out of range.\n");
  EXPECT_EQ(rc, 0);
  EXPECT_EQ(std::to_string(p_->getParmInt(1)) + p_->getParmString(2) + std::to_string(p_->getParmBool(4)) +
                p_->getParmName(8) + std::to_string(p_->getParmType(3)) + std::to_string(p_->getParmSource(4)),
            "42KLP0LIMIT_COUNT30");
  big[64] = intEntry(64, "EDGE", 0, 9, 0);  // with 64 entries there is no slot 64 to go to
  EXPECT_NE(klptest::stdoutOf([&] { klpParmClass edge(big.data() + 1, 64, &rc); })
                .find("parameter index (64) for parameter EDGE is out of range (0-64)"), std::string::npos);
  EXPECT_EQ(rc, 2002);
}

// Runs steps "op slot=value@source" split by ";", answers the sum of their rcs. Ops: i setParm
// INTEGER, b setParmBool, y setBool, s setParm STRING, c setCommand (flag 1), v setParmValue.
int apply(klpParmClass& p, const std::string& steps) {
  int rc = 0;
  std::istringstream in(steps);
  for (std::string st; std::getline(in, st, ';');) {
    size_t eq = st.find('='), at = st.rfind('@');
    int slot = std::stoi(st.substr(1, eq - 1)), src = std::stoi(st.substr(at + 1));
    std::string v = st.substr(eq + 1, at - eq - 1);
    switch (st[0]) {
      case 'i': rc += p.setParm(slot, std::stoi(v), src); break;
      case 'b': rc += p.setParmBool(slot, std::stoi(v), src); break;
      case 'y': rc += p.setBool(slot, v[0], src); break;
      case 's': rc += p.setParm(slot, v.c_str(), src); break;
      case 'c': rc += p.setCommand(slot, 1, v.c_str(), src); break;
      default: rc += p.setParmValue(slot, v.c_str(), src);
    }
  }
  return rc;
}

// Setters by source and their refusals (slot 4 is the console flag); valid values; pending changes.
TEST_F(ParmTest, SettersValidValuesAndPendingChanges) {
  const std::string sp = "<klpParmClass:setParm> 35: ", sps = "<klpParmClass::setParm> 1: ",
                    sb = "<klpParmClass:setBool> 35: ", c1040(1040, 'c'), c1041(1041, 'c');
  // A refusal answers 2002 and logs; console: the logger's flag afterwards, -1 when not looked at.
  struct { std::string steps, after; Records logged = {}; int console = -1; } cases[] = {
      {"i1=7@2", "7@2"}, {"i1=1@1;i1=100@1", "100@1"}, {"i1=0@2", "42@0", {"503 " + sp + "0|COUNT"}},
      {"i1=101@1", "42@0", {"541 " + sp + "101|COUNT|MYTABLE"}}, {"i2=5@2", "KLP@0", {"501 " + sp + "5|SCHEMA"}},
      {"i1=10@3;i1=20@2", "10@3"},  // a lower source is dropped
      {"i1=10@3;i1=20@3", "20@3"}, {"i1=10@3;i1=30@5", "30@5"},
      {"b4=1@2", "1@2", {}, 1}, {"b4=1@3;b4=0@2", "1@3", {}, 1},
      {"b1=1@2", "42@0", {"501 " + sp + "Y|COUNT"}}, {"b1=0@2", "42@0", {"501 " + sp + "N|COUNT"}},
      {"y4=y@2", "1@2", {}, 1}, {"y4=Y@2;y4=n@2", "0@2", {}, 0}, {"y4=N@4;y4=Y@3", "0@4", {}, 0},
      {"y4=x@2", "0@0", {"500 " + sb + "x|LOGSTDOUT"}}, {"y4=1@1", "0@0", {"541 " + sb + "1|LOGSTDOUT|MYTABLE"}},
      {"y1=Y@2", "42@0", {"501 " + sb + "Y|COUNT"}},
      // STRING: quotes are kept but not counted; two quotes alone empty the value and keep the source.
      {"s2=\"ABCDEFGH\"@2", "\"ABCDEFGH\"@2"},
      {"s2=\"ABCDEFGHI\"@2", "KLP@0", {"502 " + sps + "\"ABCDEFGHI\"|9|SCHEMA|8"}},
      {"s2=ABCDEFGH\"@2", "KLP@0", {"502 " + sps + "ABCDEFGH\"|9|SCHEMA|8"}},
      {"s2=ABC@4;s2=\"\"@5", "@4"}, {"s2=@2", "@0"}, {"s2=ABC@4;s2=XYZ@3", "ABC@4"}, {"s2=ABC@2;s2=XYZ@2", "XYZ@2"},
      {"s1=x@2", "42@0", {"501 " + sps + "x|COUNT"}},
      // COMMAND: whatever the priority; an empty text keeps the source; a text of at most 1040.
      {"c3=first@5;c3=second@1", "1:second@1"}, {"c3=@2", "1:@0"}, {"c1=x@2", "42@0", {"501 " + sp + "x|COUNT"}},
      {"c3=" + c1040 + "@2", "1:" + c1040 + "@2"},
      {"c3=" + c1041 + "@2", "0:@0", {"502 " + sp + c1041 + "|1041|GO|1040"}},
      // A value as a CHGPARMS change brings it.
      {"v1=77@3", "77@3"}, {"v4=yes@3;v4=no@3", "0@3", {}, 0}, {"v1=7x@3", "42@0", {"500 " + sp + "7x|COUNT"}},
  };
  for (const auto& c : cases) {
    fresh();
    EXPECT_EQ(apply(*p_, c.steps), c.logged.empty() ? 0 : 2002) << c.steps;
    EXPECT_EQ(state(*p_, c.steps[1] - '0'), c.after) << c.steps;
    EXPECT_EQ(log_.take(), c.logged) << c.steps;
    EXPECT_TRUE(c.console < 0 || log_.get()->getConsoleFlag() == c.console) << c.steps;
  }
  fresh();  // a slot set from its own text must not read freed memory
  EXPECT_EQ(apply(*p_, "s2=\"@3") + p_->setParm(2, p_->getParmString(2), 3), 0);
  EXPECT_EQ(state(*p_, 2), "\"@3");
  struct { int index; std::string text; bool ok; } valid[] = {
      {1, "42", true}, {1, "  +7", true}, {1, "7 ", false}, {1, "4x", false}, {1, "", false}, {1, "-", false},
      {1, "0", false}, {1, "101", false}, {1, "1", true}, {1, "4294967297", false},  // wraps to 1
      {1, "100", true}, {4, "yes", true}, {4, "n", true}, {4, "No", true}, {4, "Y", true}, {4, "1", false},
      {4, "YESS", false}, {4, "", false}, {3, "x", false}, {2, "any text", true},
      {2, std::string(1040, 'a'), true}, {2, std::string(1041, 'a'), false}};
  for (const auto& c : valid) EXPECT_EQ(p_->isValidValue(c.index, c.text.c_str()), c.ok) << c.text;
  std::string changeable;  // by the keyword rule, never what is not changeable
  for (const char* kw : {"count", "LOGSTDOUT", "SCHEMA", "GO", "KLPPLACEHOLDER", "X", "LIMIT", "limits_x",
                         "LIMI", static_cast<const char*>(nullptr)})
    changeable += std::to_string(p_->findChangeableParm(kw)) + " ";
  EXPECT_EQ(changeable, "1 4 -1 -1 -1 -1 8 8 -1 -1 ");
  // One pending record per parameter, at most 64 of them.
  klpParmClass& p = *p_;
  EXPECT_EQ(p.addChgParm(30, "1000") + p.addChgParm(16, "200") + p.addChgParm(30, "2000"), 0);
  EXPECT_EQ(p.getChgParmsEntry(2)->index, -1);  // free
  for (int i = 100; i < 162; ++i) ASSERT_EQ(p.addChgParm(i, "v"), 0);
  EXPECT_EQ(klptest::stdoutOf([&] { EXPECT_EQ(p.addChgParm(500, "v"), KLP_RC_BAD_PARM); }),
            "cmdParmsClass ERROR: no find room in chgparms array\n");
  EXPECT_EQ(p.addChgParm(16, "300"), 0);  // an existing record still takes a new value
  EXPECT_EQ(std::to_string(p.getChgParmsCount()) + " " + std::to_string(p.getChgParmsEntry(0)->index) +
                "=" + p.getChgParmsEntry(0)->value + " " + p.getChgParmsEntry(1)->value, "64 30=2000 300");
  EXPECT_EQ(p.getChgParmsEntry(64), nullptr);
}

// processCommandLine: slots 0 to 4 and records; the leading server name; path and password file.
TEST_F(ParmTest, CommandLineStepsRefusalsAndLeadingServer) {
  const std::string v1039(1039, 'v'), v1040(1040, 'v'), k33(33, 'K'), w41(41, 'w');
  const std::string pc = "<klpParmClass::parseCmdLine> 1: ", sp = "<klpParmClass:setParm> 35: ",
                    step = "589 <klpParmClass::processCommandLi> 1: klpParmClass::processCommandLine|",
                    pf = step + "2002|parseCmdLine", pre = step + "2002|preCmdLine";
  struct Case { std::vector<std::string> args; int rc; Records logged; std::string after = "";
                const char* sid = nullptr; };
  // Refused by parseCmdLine after a good SERVER: the record before the step's own.
  auto bad = [&](std::string arg, std::string record) { return Case{{"SERVER=a", arg}, 2002, {record, pf}}; };
  auto ok = [](std::string arg, std::string after) { return Case{{"SERVER=a", arg}, 0, {}, after}; };
  const Case cases[] = {  // after: "" when not looked at
      {{"server=db", "COUNT=7", "go=Q.1"}, 0, {}, "DB@2 7@2 KLP@0 1:Q.1@2 0@0"},
      {{"GO"}, 0, {}, "DB1@0 42@0 KLP@0 1:@0 0@0", "db1"},
      {{"SERVER=a", "GO"}, 0, {}, "A@2 42@0 KLP@0 1:@0 0@0", "db1"},
      {{"COUNT=7"}, 2002, {"524 " + pc + "SERVER", pf}}, bad("SCHEMA=\"\"", "524 " + pc + "SCHEMA"),
      {{"SERVER=a", "GO", "go"}, 2002, {"518 <klpParmClass::parseCmdLine> 1:", pf}},
      {{"SERVER=a", "KLPPLACEHOLDER=1"}, 2002, {"504 <klpParmClass:preCmdLine> 35: KLPPLACEHOLDER=1", pre}},
      bad("?", "504 " + pc + "?"), bad(k33 + "=1", "504 " + pc + k33 + "=1"), bad("COUNT", "504 " + pc + "COUNT"),
      bad("COUNT=", "500 " + pc + "|COUNT"),
      // Numbers: garbage, overflow, the 32-bit bounds and the slot's range.
      bad("COUNT=12abc", "500 " + pc + "12abc|COUNT"),
      bad("COUNT=99999999999999999999x", "503 " + pc + "99999999999999999999x|COUNT"),
      bad("COUNT=2147483647", "503 " + pc + "2147483647|COUNT"),
      bad("COUNT=-2147483648", "503 " + pc + "-2147483648|COUNT"),
      bad("COUNT=-2147483647", "503 " + sp + "-2147483647|COUNT"), bad("COUNT=101", "503 " + sp + "101|COUNT"),
      {{"SERVER=a", "COUNT=100", "COUNT=1"}, 0, {}, "A@2 1@2 KLP@0 0:@0 0@0"},
      // Switches take Y, YES, N and NO in any case.
      {{"SERVER=a", "logstdout=yEs", "LOGSTDOUT=nO"}, 0, {}, "A@2 42@0 KLP@0 0:@0 0@2"},
      ok("LOGSTDOUT", "A@2 42@0 KLP@0 0:@0 1@2"), ok("LOGSTDOUT=y", "A@2 42@0 KLP@0 0:@0 1@2"),
      bad("LOGSTDOUT=1", "501 " + pc + "1|LOGSTDOUT"), bad("LOGSTDOUT=YESS", "501 " + pc + "YESS|LOGSTDOUT"),
      // Value length: the "=" counts to the 1040; the slot's own limit after.
      {{"SERVER=" + v1040}, 2002, {"502 " + pc + v1040 + "|1041|SERVER|1040", pf}},
      {{"SERVER=" + v1039}, 2002, {"502 <klpParmClass::setParm> 1: " + v1039 + "|1039|SERVER|40",
                                   "589 " + pc + "klpParmClass::parseCmdLine|2002|klpParmClass::setParm", pf}},
      // The schema: checked early, before it is replaced and at the end; any script's letters, upper-cased.
      ok("schema=my_s", "A@2 42@0 MY_S@2 0:@0 0@0"), ok("SCHEMA=\"My\"", "A@2 42@0 My@2 0:@0 0@0"),
      bad("SCHEMA=a-b", "500 " + pc + "a-b|SCHEMA"), bad("SCHEMA=\"a b\"", "500 " + pc + "\"a b\"|SCHEMA"),
      ok("SCHEMA=\xc3\xbc" "ber", "A@2 42@0 \xc3\x9c" "BER@2 0:@0 0@0"),
      ok("SCHEMA=\"\xc3\xbc" "b\"", "A@2 42@0 \xc3\xbc" "b@2 0:@0 0@0"),
      bad("SCHEMA=\xc3\xbc-x", "500 " + pc + "\xc3\xbc-x|SCHEMA"),
      bad("SCHEMA=\xff\xfe", "500 " + pc + "\xff\xfe|SCHEMA"),
      bad("SCHEMA=\xe2\x82\xac", "500 " + pc + "\xe2\x82\xac|SCHEMA"),  // a symbol, not a letter
      {{"SCHEMA=a-b", "SCHEMA=good"}, 2002, {"500 <klpParmClass::preCmdLine> 35: a-b|SCHEMA", pre}},
      {{"SCHEMA=ABCDEFGHI"}, 2002, {"502 <klpParmClass::setParm> 1: ABCDEFGHI|9|SCHEMA|8",
                                    "589 <klpParmClass::preCmdLine> 1: klpParmClass::preCmdLine|2002|setParm", pre}},
      {{"SERVER=a"}, 2002, {"502 <klpParmClass::setParm> 1: " + w41 + "|41|SERVER|40",  // ORACLE_SID too long
                            "589 <klpParmClass::preCmdLine> 1: klpParmClass::preCmdLine|2002|setParm", pre},
       "", w41.c_str()},
      {{"PWDFILE=missing.aut", "SERVER=a"}, 806,
       {"545 " + pc + dir_.path() + "missing.aut", step + "806|parseCmdLine"}},
      {{"?"}, 416, {step + "416|preCmdLine"}},
  };
  for (const auto& c : cases) {
    fresh();
    SCOPED_TRACE(c.args.back().substr(0, 40));
    std::string out = klptest::stdoutOf([&] { EXPECT_EQ(parse(c.args, c.sid), c.rc); });
    EXPECT_EQ(log_.take(), c.logged);
    EXPECT_TRUE(c.after.empty() || states(*p_) == c.after) << states(*p_);
    EXPECT_EQ(out.rfind("usage\n", 0) == 0, c.rc == 416);  // printed before anything else
  }
  EXPECT_STREQ(setlocale(LC_CTYPE, nullptr), "C");  // the caller's locale is untouched
  // A leading word naming no parameter is the server; one naming one, only if nothing else names it.
  const std::string big = "502 <klpParmClass::setParm> 1: " + w41 + "|41|SERVER|40",
                    set = "589 <klpParmClass::getPositionalDBN> 1: klpParmClass::getPositionalDBName|2002|setParm ";
  struct { std::vector<std::string> args; std::string sid, want; int rc = 0; Records logged = {}; } rows[] = {
      {{"mydb", "GO"}, "", "1 mydb@2"}, {{"GO"}, "", "1 GO@2"}, {{"GO"}, "db1", "0 db1@0"},
      {{"COUNT"}, "db1", "0 db1@0"}, {{"GO", "server=x"}, "", "0 @0"}, {{"COUNT=1", "server=x"}, "", "0 @0"},
      {{"klpplaceholder"}, "db1", "1 klpplaceholder@2"}, {{"COUNT=1"}, "db1", "0 @0"}, {{}, "", "0 @0"},
      {{"COUNT=1"}, "", "0 @0", 2003, {"524 <klpParmClass::getPositionalDBN> 1: SERVER"}},
      {{w41}, "", "0 @0", 2002, {big, set + "1"}}, {{"GO"}, w41, "0 @0", 2002, {big, set + "3"}},
  };
  for (const auto& c : rows) {
    fresh();
    std::string leading;  // "consumed server@source"
    EXPECT_EQ(parse(c.args, c.sid.c_str(), &leading), c.rc);
    EXPECT_EQ(leading, c.want);
    EXPECT_EQ(log_.take(), c.logged) << &c - rows;
  }
  // The path is the working directory; klppwd.aut there is the default; CHGPARMS beats the command line.
  fresh();
  ASSERT_EQ(parse({"SERVER=a", "SCHEMA=\"Sch\""}), 0);
  EXPECT_EQ(states(*p_, {7, 6}), dir_.path() + "@0 @0");
  EXPECT_STREQ(log_.get()->getProgramQualifier(), "\"Sch\"");  // as typed, before the rule
  fclose(fopen((dir_.path() + "klppwd.aut").c_str(), "w"));
  for (auto [pwd, want] : {std::pair{"COUNT=1", "klppwd.aut@0"}, {"PWDFILE=klppwd.aut", "klppwd.aut@2"}}) {
    fresh();
    ASSERT_EQ(parse({"SERVER=a", pwd}), 0);
    EXPECT_EQ(state(*p_, 6), want);
  }
  fresh();
  ASSERT_EQ(apply(*p_, "i1=9@3;s2=OLD@4") + parse({"SERVER=a", "COUNT=7", "SCHEMA=NEW"}), 0);
  EXPECT_EQ(states(*p_), "A@2 9@3 OLD@4 0:@0 0@0");
}

// A query message's exact bytes, its printout, and the parsing of a damaged one.
TEST_F(ParmTest, QueryMessageBytesPrintoutAndDamage) {
  klpParmClass& p = *p_;
  ASSERT_EQ(apply(p, "s0=DB1@2;b4=1@3"), 0);
  // Included: 0, 1, 2 and 4 (display 1); 5 only once it is set; 6, 7 never.
  std::string expected("\x04\x00KLPQRYMG", 10);
  for (auto [source, name, value] : {std::tuple<int, std::string, std::string>{2, "SERVER", "DB1"},
                                     {0, "COUNT", "42"}, {0, "SCHEMA", "KLP"}, {3, "LOGSTDOUT", "Y"}})
    expected += std::string{static_cast<char>(40 + value.size()), 0, static_cast<char>(source), 0,
                            static_cast<char>(name.size()), 0} + name + std::string(32 - name.size(), '\0') +
                std::string{static_cast<char>(value.size()), 0} + value;
  std::string msg(p.getQueryMsgSize(), '\xEE');
  ASSERT_EQ(p.setQueryMsg(msg.data()), 0);
  EXPECT_EQ(msg, expected);
  ASSERT_EQ(apply(p, "s5=\"v\"@1;b4=0@5"), 0);
  EXPECT_EQ(p.getQueryMsgSize(), expected.size() + 40 + 3);
  msg.assign(p.getQueryMsgSize(), 0);
  p.setQueryMsg(msg.data());
  log_.take();
  // The same five, from the message and from the registry.
  const Records shown = {"SERVER|DB1|COMMANDLINE", "COUNT|42|DEFAULT", "SCHEMA|KLP|DEFAULT",
                         "LOGSTDOUT|N|K APPLY OVERRIDE", "SOMETIMES|\"v\"|MYTABLE"};
  Records want;
  for (std::string how : {"521 <klpParmClass:getQueryMsg> 35: ", "529 <klpParmClass::printParms> 1: "})
    for (const std::string& v : shown) want.push_back(how + v);
  EXPECT_EQ(p.getQueryMsg(msg.data(), msg.size()), 0);
  p.printParms();
  EXPECT_EQ(log_.take(), want);
  std::string labels;
  for (int s = -1; s < 7; ++s) labels += std::string(parmSourceLabel(s, "T")) + ",";
  EXPECT_EQ(labels, "UNKNOWN,DEFAULT,T,COMMANDLINE,CHGPARMS COMMAND,SYSTEM OVERRIDE,K APPLY OVERRIDE,UNKNOWN,");
  // Every length received is checked. cut: bytes off the end; printed: records before the end.
  struct { std::vector<std::pair<size_t, uint8_t>> patch; size_t cut; int rc, printed; } cases[] = {
      {{{0, 0}}, msg.size() - 10, 0, 0},  // the bare header of an empty selection
      {{}, msg.size() - 9, 2002, 0},      // shorter than the header
      {{}, 1, 2002, 4},                   // last value cut short
      {{{0, 6}}, 0, 2002, 5},             // one record more than there is
      {{{10, 39}, {11, 0}}, 0, 2002, 0},  // a record length below 40 must not loop
      {{{10, 0}, {11, 0}}, 0, 2002, 0},   {{{14, 33}}, 0, 2002, 0},  // name beyond its 32 bytes
      {{{14, 32}}, 0, 0, 5},              {{{48, 0xFF}, {49, 0xFF}}, 0, 2002, 0},  // value beyond the message
      {{{10, 0xFF}, {11, 0x7F}}, 0, 2002, 0},  // record beyond the message
      {{{12, 6}}, 0, 0, 5},                    // an unknown source
  };
  for (const auto& c : cases) {
    std::string m = msg.substr(0, msg.size() - c.cut);  // exact size: a read past the end is caught
    for (auto [at, value] : c.patch) m[at] = static_cast<char>(value);
    EXPECT_EQ(p_->getQueryMsg(m.data(), m.size()), c.rc) << &c - cases;
    Records printed = log_.take();
    EXPECT_EQ(static_cast<int>(printed.size()), c.printed);
    EXPECT_TRUE(&c != std::end(cases) - 1 || printed[0] == "521 <klpParmClass:getQueryMsg> 35: SERVER|DB1|UNKNOWN");
  }
  EXPECT_EQ(p_->getQueryMsg(nullptr, 0), KLP_RC_BAD_PARM);
  p_.reset();  // a registry that goes away stops being current
  EXPECT_EQ(klpGetCurrentParms(), nullptr);
}

}  // namespace
