// The two parameter sets and their command-line rules, in process: which
// values end up where, which pending CHGPARMS records are made, and which
// message refuses what.
#include <gtest/gtest.h>

#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <set>
#include <string>
#include <vector>

#include "common/msg/msglogger.h"
#include "common/util/klprc.h"
#include "tests/testing/klptest.h"
#include "xqpub/kcapcmdparms.h"
#include "xqpub/xqpubparms.h"

namespace {

// Sets or clears an environment variable for the life of the object.
class ScopedEnv {
 public:
  ScopedEnv(const char* name, const char* value) : name_(name) {
    const char* old = getenv(name);
    had_ = old != nullptr;
    if (had_) old_ = old;
    if (value)
      setenv(name, value, 1);
    else
      unsetenv(name);
  }
  ~ScopedEnv() {
    if (had_)
      setenv(name_.c_str(), old_.c_str(), 1);
    else
      unsetenv(name_.c_str());
  }

 private:
  std::string name_, old_;
  bool had_ = false;
};

struct Parsed {
  int rc = -1;
  std::string out;
};

class ParmSetTest : public ::testing::Test {
 protected:
  void SetUp() override {
    logger_ = createMsgLoggerU(MSG_APP_KLPKCCMD, 0);
    ASSERT_NE(logger_, nullptr);
    logger_->loadBuiltinMsgs(builtinMsgTable);
    klpSetProcessLogger(logger_);
    make();
    // The password file is looked for in the working directory.
    ASSERT_NE(getcwd(oldCwd_, sizeof oldCwd_), nullptr);
    ASSERT_EQ(chdir(dir_.path().c_str()), 0);
  }
  // Fresh parameter objects, as a new run of the program has.
  void make() {
    ParmEntry ct[KCAPCMD_PARM_COUNT];
    buildKCapCmdParmTable(ct);
    int rc = -1;
    cmd_ = new kCapCmdParmClass(ct, KCAPCMD_PARM_COUNT, &rc);
    ASSERT_EQ(rc, 0);
    ParmEntry st[XQPUB_PARM_COUNT];
    buildXqpubParmTable(st);
    server_ = new xqpubParms(st, XQPUB_PARM_COUNT, &rc);
    ASSERT_EQ(rc, 0);
    cmd_->setServerParms(server_);
    cmd_->setUsageText(kCapCmdUsageText);
    klpSetCurrentParms(cmd_);
  }
  void reset() {
    klpSetCurrentParms(nullptr);
    delete cmd_;
    delete server_;
    make();
  }
  void TearDown() override {
    EXPECT_EQ(chdir(oldCwd_), 0);
    klpSetCurrentParms(nullptr);
    delete cmd_;
    delete server_;
    klpSetProcessLogger(nullptr);
    delete logger_;
  }
  static Parsed run(klpParmClass* p, std::vector<std::string> args) {
    args.insert(args.begin(), "klpkccmd");
    std::vector<char*> argv;
    for (auto& a : args) argv.push_back(a.data());
    argv.push_back(nullptr);
    fflush(stdout);
    ::testing::internal::CaptureStdout();
    Parsed r;
    r.rc = p->processCommandLine(static_cast<int>(args.size()), argv.data());
    fflush(stdout);
    r.out = ::testing::internal::GetCapturedStdout();
    return r;
  }
  Parsed cmd(const std::vector<std::string>& args) { return run(cmd_, args); }
  Parsed srv(const std::vector<std::string>& args) { return run(server_, args); }

  ScopedEnv sid_{"ORACLE_SID", nullptr};
  klptest::TmpDir dir_;
  char oldCwd_[4096] = {0};
  msgLogger* logger_ = nullptr;
  kCapCmdParmClass* cmd_ = nullptr;
  xqpubParms* server_ = nullptr;
};

bool has(const Parsed& p, const char* id) { return p.out.find(id) != std::string::npos; }

TEST_F(ParmSetTest, TablesAreCompleteAndNumberedOnce) {
  std::set<int> seen;
  ParmEntry st[XQPUB_PARM_COUNT];
  buildXqpubParmTable(st);
  for (const auto& e : st) EXPECT_TRUE(seen.insert(e.index).second) << e.index;
  EXPECT_EQ(seen.size(), 56u);
  EXPECT_EQ(*seen.rbegin(), 55);
  seen.clear();
  ParmEntry ct[KCAPCMD_PARM_COUNT];
  buildKCapCmdParmTable(ct);
  for (const auto& e : ct) {
    EXPECT_TRUE(seen.insert(e.index).second) << e.index;
    EXPECT_EQ(e.display, 0);  // nothing of the command set is ever printed
  }
  EXPECT_EQ(*seen.rbegin(), 25);
  EXPECT_EQ(cmd_->getQueryMsgSize(), 10u);
  EXPECT_EQ(std::string(kCapCmdUsageText).size(), 892u);
}

TEST_F(ParmSetTest, ChgparmsCollectsPendingRecords) {
  Parsed p = cmd({"CAPTURE_SERVER=x", "CHGPARMS", "COMMIT_INTERVAL=1000", "SLEEP_INTERVAL=200"});
  ASSERT_EQ(p.rc, 0) << p.out;
  EXPECT_EQ(cmd_->getNamedCommand(), KCAPCMD_CHGPARMS);
  ASSERT_EQ(cmd_->getChgParmsCount(), 2);
  EXPECT_EQ(cmd_->getChgParmsEntry(0)->index, 30);
  EXPECT_STREQ(cmd_->getChgParmsEntry(0)->value, "1000");
  EXPECT_EQ(cmd_->getChgParmsEntry(1)->index, 16);
  EXPECT_STREQ(cmd_->getChgParmsEntry(1)->value, "200");
  // The server set is only consulted, never changed.
  EXPECT_EQ(server_->getParmInt(30), 500);
}

TEST_F(ParmSetTest, ChgparmsRepeatedPrefixAndGroupEnd) {
  Parsed p = cmd({"x", "CHGPARMS", "COMMIT_INTERVAL=1000", "qfull_numbers=5",
                  "COMMIT_INTERVAL=2000", "LOGSTDOUT=y"});
  ASSERT_EQ(p.rc, 0) << p.out;
  ASSERT_EQ(cmd_->getChgParmsCount(), 3);
  EXPECT_EQ(cmd_->getChgParmsEntry(0)->index, 30);
  EXPECT_STREQ(cmd_->getChgParmsEntry(0)->value, "2000");
  EXPECT_EQ(cmd_->getChgParmsEntry(1)->index, 37);  // matched by "QFULL_N"
  EXPECT_STREQ(cmd_->getChgParmsEntry(1)->value, "5");
  EXPECT_EQ(cmd_->getChgParmsEntry(2)->index, 4);  // LOGSTDOUT is changeable
  EXPECT_EQ(cmd_->getParmBool(4), 0);              // ... and so not the command's own
}

TEST_F(ParmSetTest, ServerNameByWordKeywordOrEnvironment) {
  Parsed p = cmd({"STATUS"});
  EXPECT_EQ(p.rc, KLP_RC_BAD_PARM);
  EXPECT_TRUE(has(p, "KLP0526E")) << p.out;
  EXPECT_STREQ(cmd_->getParmString(0), "STATUS");
}

TEST_F(ParmSetTest, OracleSidNamesTheServer) {
  ScopedEnv sid("ORACLE_SID", "db1");
  Parsed p = cmd({"STATUS"});
  ASSERT_EQ(p.rc, 0) << p.out;
  EXPECT_STREQ(cmd_->getParmString(0), "DB1");
  EXPECT_EQ(cmd_->getParmSource(0), PARM_SRC_DEFAULT);
  EXPECT_EQ(cmd_->getNamedCommand(), KCAPCMD_STATUS);
}

TEST_F(ParmSetTest, LeadingWordAndKeyword) {
  Parsed p = cmd({"mydb", "STOP"});
  ASSERT_EQ(p.rc, 0) << p.out;
  EXPECT_STREQ(cmd_->getParmString(0), "MYDB");
  EXPECT_EQ(cmd_->getParmSource(0), PARM_SRC_COMMANDLINE);
  EXPECT_EQ(cmd_->getNamedCommand(), KCAPCMD_STOP);

  // A keyword given later wins over the leading word.
  Parsed q = cmd({"mydb", "capture_server=other", "SUSPEND"});
  ASSERT_EQ(q.rc, 0) << q.out;
  EXPECT_STREQ(cmd_->getParmString(0), "OTHER");
}

TEST_F(ParmSetTest, CommandWordsAndTheirArguments) {
  Parsed p = cmd({"x", "STARTQ"});
  ASSERT_EQ(p.rc, 0) << p.out;
  EXPECT_STREQ(cmd_->getCommandText(KCAPCMD_STARTQ), "");
  reset();
  Parsed q = cmd({"x", "STOPQ="});
  ASSERT_EQ(q.rc, 0) << q.out;
  EXPECT_STREQ(cmd_->getCommandText(KCAPCMD_STOPQ), "");
  reset();
  Parsed r = cmd({"x", "reinitq=Q.One"});
  ASSERT_EQ(r.rc, 0) << r.out;
  EXPECT_EQ(cmd_->getNamedCommand(), KCAPCMD_REINITQ);
  EXPECT_STREQ(cmd_->getCommandText(KCAPCMD_REINITQ), "Q.One");
}

TEST_F(ParmSetTest, SwitchesTakeYesAndNoOnly) {
  Parsed p = cmd({"x", "LOGSTDOUT", "RESUME"});
  ASSERT_EQ(p.rc, 0) << p.out;
  EXPECT_EQ(cmd_->getParmBool(4), 1);
  EXPECT_EQ(logger_->getConsoleFlag(), 1);
  reset();
  Parsed q = cmd({"x", "LOGSTDOUT=no"});  // no command: refused, the switch is set
  EXPECT_TRUE(has(q, "KLP0526E")) << q.out;
  EXPECT_EQ(cmd_->getParmBool(4), 0);
  EXPECT_EQ(logger_->getConsoleFlag(), 0);
  Parsed r = cmd({"x", "LOGSTDOUT=1", "STOP"});
  EXPECT_EQ(r.rc, KLP_RC_BAD_PARM);
  EXPECT_TRUE(has(r, "KLP0501E")) << r.out;
}

TEST_F(ParmSetTest, SchemaQuotingAndCase) {
  Parsed p = cmd({"x", "CAPTURE_SCHEMA=\"My_Schema\"", "STOP"});
  ASSERT_EQ(p.rc, 0) << p.out;
  EXPECT_STREQ(cmd_->getParmString(2), "My_Schema");
  EXPECT_STREQ(logger_->getProgramQualifier(), "\"My_Schema\"");  // as typed, before the rule
}

TEST_F(ParmSetTest, SchemaUnquotedIsUpperCasedAndChecked) {
  Parsed p = cmd({"x", "capture_schema=my_schema", "STOP"});
  ASSERT_EQ(p.rc, 0) << p.out;
  EXPECT_STREQ(cmd_->getParmString(2), "MY_SCHEMA");
}

// Upper case of U+0250 (2 bytes) is U+2C6F (3 bytes): the value grows and
// must be stored anew rather than written over its old text.
TEST_F(ParmSetTest, MultibyteSchemaThatGrowsWhenUpperCased) {
  ScopedEnv loc("LC_ALL", "C.UTF-8");
  Parsed p = cmd({"x", "CAPTURE_SCHEMA=\xc9\x90\xc9\x90\xc9\x90", "STOP"});
  ASSERT_EQ(p.rc, 0) << p.out;
  EXPECT_STREQ(cmd_->getParmString(2), "\xe2\xb1\xaf\xe2\xb1\xaf\xe2\xb1\xaf");
  reset();
  Parsed q = cmd({"x", "CAPTURE_SCHEMA=\xc3\xbc\xff", "STOP"});  // invalid sequence
  EXPECT_TRUE(has(q, "KLP0500E")) << q.out;
}

TEST_F(ParmSetTest, SchemaGivenTwiceChecksTheFirst) {
  Parsed p = cmd({"x", "CAPTURE_SCHEMA=bad-one", "CAPTURE_SCHEMA=good", "STOP"});
  EXPECT_EQ(p.rc, KLP_RC_BAD_PARM);
  EXPECT_TRUE(has(p, "KLP0500E")) << p.out;
  EXPECT_TRUE(has(p, "\"bad-one\"")) << p.out;
}

TEST_F(ParmSetTest, PathAndPasswordFile) {
  Parsed p = cmd({"x", "STOP"});
  ASSERT_EQ(p.rc, 0) << p.out;
  // The path is the working directory with a trailing "/"; no password file
  // there, so none is named.
  EXPECT_EQ(std::string(cmd_->peekSlot(7)->strValue), dir_.path());
  EXPECT_STREQ(cmd_->peekSlot(6)->strValue, "");

  FILE* f = fopen((dir_.path() + "klppwd.aut").c_str(), "w");
  ASSERT_NE(f, nullptr);
  fclose(f);
  Parsed q = srv({"x"});
  ASSERT_EQ(q.rc, 0) << q.out;
  EXPECT_STREQ(server_->getParmString(6), "klppwd.aut");
  EXPECT_EQ(server_->getParmSource(6), PARM_SRC_DEFAULT);
  remove((dir_.path() + "klppwd.aut").c_str());
}

TEST_F(ParmSetTest, ServerRuleRefusalsAndShortForms) {
  Parsed p = srv({"x", "qmgr=QM1"});
  EXPECT_EQ(p.rc, KLP_RC_BAD_PARM);
  EXPECT_TRUE(has(p, "KLP0504E")) << p.out;

  Parsed q = srv({"x", "STARTMODE=cold", "RN=5", "RD=20", "TRANSID=abc"});
  ASSERT_EQ(q.rc, 0) << q.out;
  EXPECT_STREQ(server_->getParmString(XQPUB_STARTMODE), "COLD");
  EXPECT_EQ(server_->getParmInt(XQPUB_QFULL_NUM_RETRIES), 5);
  EXPECT_EQ(server_->getParmSource(XQPUB_QFULL_NUM_RETRIES), PARM_SRC_COMMANDLINE);
  EXPECT_EQ(server_->getParmInt(XQPUB_QFULL_RETRY_DELAY), 20);
  EXPECT_STREQ(server_->getParmString(XQPUB_IGNORE_TRANSID), "abc");
}

TEST_F(ParmSetTest, ServerLongFormWinsOverShortForm) {
  Parsed q = srv({"x", "QFULL_NUM_RETRIES=7", "RN=5"});
  ASSERT_EQ(q.rc, 0) << q.out;
  EXPECT_EQ(server_->getParmInt(XQPUB_QFULL_NUM_RETRIES), 7);
}

TEST_F(ParmSetTest, ServerStartModeAndIntegers) {
  Parsed p = srv({"x", "STARTMODE=warm"});
  EXPECT_EQ(p.rc, KLP_RC_BAD_PARM);
  EXPECT_TRUE(has(p, "KLP0500E")) << p.out;
  EXPECT_TRUE(has(p, "STARTMODE")) << p.out;

  struct {
    const char* arg;
    const char* id;
  } cases[] = {{"COMMIT_INTERVAL=12abc", "KLP0500E"},
               {"COMMIT_INTERVAL=99999999999", "KLP0503E"},
               {"COMMIT_INTERVAL=99999999999999999999", "KLP0503E"},
               {"COMMIT_INTERVAL=50", "KLP0503E"},
               {"COMMIT_INTERVAL=", "KLP0500E"},
               {"COMMIT_INTERVAL", "KLP0504E"},
               {"PWDFILE=missing.aut", "KLP0545E"}};
  for (const auto& c : cases) {
    reset();
    Parsed r = srv({"x", c.arg});
    EXPECT_NE(r.rc, 0) << c.arg;
    EXPECT_TRUE(has(r, c.id)) << c.arg << ":\n" << r.out;
  }
  reset();
  Parsed r = srv({"x", "PWDFILE=missing.aut"});
  EXPECT_EQ(r.rc, 806);
  EXPECT_TRUE(has(r, (dir_.path() + "missing.aut").c_str())) << r.out;
}

TEST_F(ParmSetTest, CommandLineNeverReplacesAChgparmsValue) {
  ASSERT_EQ(server_->setParmValue(XQPUB_COMMIT_INTERVAL, "1000", PARM_SRC_CHGPARMS), 0);
  Parsed p = srv({"x", "COMMIT_INTERVAL=2000"});
  ASSERT_EQ(p.rc, 0) << p.out;
  EXPECT_EQ(server_->getParmInt(XQPUB_COMMIT_INTERVAL), 1000);
  EXPECT_EQ(server_->getParmSource(XQPUB_COMMIT_INTERVAL), PARM_SRC_CHGPARMS);
}

}  // namespace
