// The two parameter sets and their command-line rules, in process: which
// values end up where, which pending CHGPARMS records are made, and which
// message refuses what.
#include <gtest/gtest.h>

#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "common/msg/msglogger.h"
#include "common/util/klprc.h"
#include "tests/testing/klptest.h"
#include "xqpub/kcapcmdparms.h"
#include "xqpub/xqpubparms.h"

namespace {

// Sets (or clears, for null) an environment variable for the life of the object.
class ScopedEnv {
 public:
  ScopedEnv(const char* name, const char* value) : name_(name) {
    if (const char* old = getenv(name)) old_ = old;
    value ? setenv(name, value, 1) : unsetenv(name);
  }
  ~ScopedEnv() { old_ ? setenv(name_.c_str(), old_->c_str(), 1) : unsetenv(name_.c_str()); }

 private:
  std::string name_;
  std::optional<std::string> old_;
};

struct Parsed {
  int rc = -1;
  std::string out;
  bool has(const std::string& what) const { return out.find(what) != std::string::npos; }
};

class ParmSetTest : public ::testing::Test {
 protected:
  void SetUp() override {
    logger_ = std::make_unique<klptest::ProcessLogger>();
    reset();
    // The password file is looked for in the working directory.
    ASSERT_NE(getcwd(oldCwd_, sizeof oldCwd_), nullptr);
    ASSERT_EQ(chdir(dir_.path().c_str()), 0);
  }
  // Fresh parameter objects, as a new run of the program has.
  void reset() {
    clear();
    ParmEntry ct[KCAPCMD_PARM_COUNT];
    buildKCapCmdParmTable(ct);
    int rc = -1;
    cmd_ = std::make_unique<kCapCmdParmClass>(ct, KCAPCMD_PARM_COUNT, &rc);
    ASSERT_EQ(rc, 0);
    ParmEntry st[XQPUB_PARM_COUNT];
    buildXqpubParmTable(st);
    server_ = std::make_unique<xqpubParms>(st, XQPUB_PARM_COUNT, &rc);
    ASSERT_EQ(rc, 0);
    cmd_->setServerParms(server_.get());
    cmd_->setUsageText(kCapCmdUsageText);
    klpSetCurrentParms(cmd_.get());
  }
  void clear() {
    klpSetCurrentParms(nullptr);
    cmd_.reset();
    server_.reset();
  }
  void TearDown() override {
    EXPECT_EQ(chdir(oldCwd_), 0);
    clear();
    logger_.reset();
  }
  static Parsed run(klpParmClass* p, std::vector<std::string> args) {
    args.insert(args.begin(), "klpkccmd");
    std::vector<char*> argv;
    for (auto& a : args) argv.push_back(a.data());
    argv.push_back(nullptr);
    fflush(stdout);
    ::testing::internal::CaptureStdout();
    int rc = p->processCommandLine(static_cast<int>(args.size()), argv.data());
    fflush(stdout);
    return {rc, ::testing::internal::GetCapturedStdout()};
  }
  Parsed cmd(const std::vector<std::string>& args) { return run(cmd_.get(), args); }
  Parsed srv(const std::vector<std::string>& args) { return run(server_.get(), args); }
  // The same, in a new run of the program.
  Parsed newCmd(const std::vector<std::string>& args) { return reset(), cmd(args); }
  Parsed newSrv(const std::vector<std::string>& args) { return reset(), srv(args); }

  ScopedEnv sid_{"ORACLE_SID", nullptr};
  klptest::TmpDir dir_;
  char oldCwd_[4096] = {0};
  std::unique_ptr<klptest::ProcessLogger> logger_;
  std::unique_ptr<kCapCmdParmClass> cmd_;
  std::unique_ptr<xqpubParms> server_;
};

TEST_F(ParmSetTest, TablesAreNumberedOnceAndTheCommandSetIsNeverPrinted) {
  ParmEntry st[XQPUB_PARM_COUNT], ct[KCAPCMD_PARM_COUNT];
  buildXqpubParmTable(st);
  buildKCapCmdParmTable(ct);
  std::set<int> server, command;
  for (const auto& e : st) EXPECT_TRUE(server.insert(e.index).second) << e.index;
  for (const auto& e : ct) EXPECT_TRUE(command.insert(e.index).second && e.display == 0) << e.index;
  EXPECT_EQ(cmd_->getQueryMsgSize(), 10u);
}

TEST_F(ParmSetTest, ChgparmsCollectsPendingRecords) {
  Parsed p = cmd({"CAPTURE_SERVER=x", "CHGPARMS", "COMMIT_INTERVAL=1000", "SLEEP_INTERVAL=200",
                  "qfull_numbers=5", "COMMIT_INTERVAL=2000", "LOGSTDOUT=y"});
  ASSERT_EQ(p.rc, 0) << p.out;
  EXPECT_EQ(cmd_->getNamedCommand(), KCAPCMD_CHGPARMS);
  ASSERT_EQ(cmd_->getChgParmsCount(), 4);
  const std::pair<int, const char*> expected[] = {{30, "2000"}, {16, "200"}, {37, "5"}};
  for (int i = 0; i < 3; ++i) {  // 37 is matched by "QFULL_N"
    EXPECT_EQ(cmd_->getChgParmsEntry(i)->index, expected[i].first) << i;
    EXPECT_STREQ(cmd_->getChgParmsEntry(i)->value, expected[i].second) << i;
  }
  EXPECT_EQ(cmd_->getChgParmsEntry(3)->index, 4);
  // LOGSTDOUT is changeable and so not the command's own; the server set is
  // only consulted, never changed.
  EXPECT_EQ(cmd_->getParmBool(4), 0);
  EXPECT_EQ(server_->getParmInt(30), 500);
}

TEST_F(ParmSetTest, ServerNameByWordKeywordOrEnvironment) {
  Parsed p = cmd({"STATUS"});
  EXPECT_EQ(p.rc, KLP_RC_BAD_PARM);
  EXPECT_TRUE(p.has("KLP0526E")) << p.out;
  EXPECT_STREQ(cmd_->getParmString(0), "STATUS");
  {
    ScopedEnv sid("ORACLE_SID", "db1");
    p = newCmd({"STATUS"});
    ASSERT_EQ(p.rc, 0) << p.out;
    EXPECT_STREQ(cmd_->getParmString(0), "DB1");
    EXPECT_EQ(cmd_->getParmSource(0), PARM_SRC_DEFAULT);
    EXPECT_EQ(cmd_->getNamedCommand(), KCAPCMD_STATUS);
  }
  p = newCmd({"mydb", "STOP"});
  ASSERT_EQ(p.rc, 0) << p.out;
  EXPECT_STREQ(cmd_->getParmString(0), "MYDB");
  EXPECT_EQ(cmd_->getParmSource(0), PARM_SRC_COMMANDLINE);
  EXPECT_EQ(cmd_->getNamedCommand(), KCAPCMD_STOP);
  // A keyword given later wins over the leading word.
  p = cmd({"mydb", "capture_server=other", "SUSPEND"});
  ASSERT_EQ(p.rc, 0) << p.out;
  EXPECT_STREQ(cmd_->getParmString(0), "OTHER");
}

TEST_F(ParmSetTest, CommandWordsAndTheirArguments) {
  struct Case { const char* arg; int command; const char* text; };
  for (const Case& c : {Case{"STARTQ", KCAPCMD_STARTQ, ""}, Case{"STOPQ=", KCAPCMD_STOPQ, ""},
                        Case{"reinitq=Q.One", KCAPCMD_REINITQ, "Q.One"}}) {
    Parsed p = newCmd({"x", c.arg});
    ASSERT_EQ(p.rc, 0) << c.arg << ":\n" << p.out;
    EXPECT_EQ(cmd_->getNamedCommand(), c.command) << c.arg;
    EXPECT_STREQ(cmd_->getCommandText(c.command), c.text) << c.arg;
  }
}

TEST_F(ParmSetTest, SwitchesTakeYesAndNoOnly) {
  Parsed p = cmd({"x", "LOGSTDOUT", "RESUME"});
  ASSERT_EQ(p.rc, 0) << p.out;
  EXPECT_EQ(cmd_->getParmBool(4), 1);
  EXPECT_EQ(logger_->get()->getConsoleFlag(), 1);
  p = newCmd({"x", "LOGSTDOUT=no"});  // no command: refused, the switch is set
  EXPECT_TRUE(p.has("KLP0526E")) << p.out;
  EXPECT_EQ(cmd_->getParmBool(4), 0);
  EXPECT_EQ(logger_->get()->getConsoleFlag(), 0);
  p = cmd({"x", "LOGSTDOUT=1", "STOP"});
  EXPECT_EQ(p.rc, KLP_RC_BAD_PARM);
  EXPECT_TRUE(p.has("KLP0501E")) << p.out;
}

TEST_F(ParmSetTest, SchemaQuotingCaseAndChecks) {
  Parsed p = cmd({"x", "CAPTURE_SCHEMA=\"My_Schema\"", "STOP"});
  ASSERT_EQ(p.rc, 0) << p.out;
  EXPECT_STREQ(cmd_->getParmString(2), "My_Schema");
  EXPECT_STREQ(logger_->get()->getProgramQualifier(), "\"My_Schema\"");  // as typed, before the rule
  p = newCmd({"x", "capture_schema=my_schema", "STOP"});
  ASSERT_EQ(p.rc, 0) << p.out;
  EXPECT_STREQ(cmd_->getParmString(2), "MY_SCHEMA");

  // Given twice, the first is checked.
  p = newCmd({"x", "CAPTURE_SCHEMA=bad-one", "CAPTURE_SCHEMA=good", "STOP"});
  EXPECT_EQ(p.rc, KLP_RC_BAD_PARM);
  EXPECT_TRUE(p.has("KLP0500E") && p.has("\"bad-one\"")) << p.out;

  // Upper case of U+0250 (2 bytes) is U+2C6F (3 bytes): the value grows and
  // must be stored anew rather than written over its old text.
  ScopedEnv loc("LC_ALL", "C.UTF-8");
  p = newCmd({"x", "CAPTURE_SCHEMA=\xc9\x90\xc9\x90\xc9\x90", "STOP"});
  ASSERT_EQ(p.rc, 0) << p.out;
  EXPECT_STREQ(cmd_->getParmString(2), "\xe2\xb1\xaf\xe2\xb1\xaf\xe2\xb1\xaf");
  p = newCmd({"x", "CAPTURE_SCHEMA=\xc3\xbc\xff", "STOP"});  // invalid sequence
  EXPECT_TRUE(p.has("KLP0500E")) << p.out;
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
  p = srv({"x"});
  ASSERT_EQ(p.rc, 0) << p.out;
  EXPECT_STREQ(server_->getParmString(6), "klppwd.aut");
  EXPECT_EQ(server_->getParmSource(6), PARM_SRC_DEFAULT);
  remove((dir_.path() + "klppwd.aut").c_str());

  // A named password file that does not exist.
  p = newSrv({"x", "PWDFILE=missing.aut"});
  EXPECT_EQ(p.rc, 806);
  EXPECT_TRUE(p.has("KLP0545E") && p.has(dir_.path() + "missing.aut")) << p.out;

  // A working directory at the longest a value may be still gets its "/":
  // the separator is not held to the value's limit.
  std::string deep = dir_.path().substr(0, dir_.path().size() - 1);
  while (deep.size() < 1040) {
    size_t room = 1040 - deep.size();
    deep += "/" + std::string(room <= 201 ? room - 1 : 100, 'd');
    ASSERT_EQ(mkdir(deep.c_str(), 0700), 0) << deep.size();
  }
  ASSERT_EQ(chdir(deep.c_str()), 0);
  p = newCmd({"x", "STOP"});
  ASSERT_EQ(p.rc, 0) << p.out;
  EXPECT_EQ(std::string(cmd_->peekSlot(7)->strValue), deep + "/");
  p = newSrv({"x"});
  ASSERT_EQ(p.rc, 0) << p.out;
  EXPECT_EQ(std::string(server_->getParmString(7)), deep + "/");
}

TEST_F(ParmSetTest, ServerShortFormsAndPriority) {
  Parsed p = srv({"x", "STARTMODE=cold", "RN=5", "RD=20", "TRANSID=abc"});
  ASSERT_EQ(p.rc, 0) << p.out;
  EXPECT_STREQ(server_->getParmString(XQPUB_STARTMODE), "COLD");
  EXPECT_EQ(server_->getParmInt(XQPUB_QFULL_NUM_RETRIES), 5);
  EXPECT_EQ(server_->getParmSource(XQPUB_QFULL_NUM_RETRIES), PARM_SRC_COMMANDLINE);
  EXPECT_EQ(server_->getParmInt(XQPUB_QFULL_RETRY_DELAY), 20);
  EXPECT_STREQ(server_->getParmString(XQPUB_IGNORE_TRANSID), "abc");

  // The long form wins over the short form; the command line never replaces
  // a CHGPARMS value.
  reset();
  ASSERT_EQ(server_->setParmValue(XQPUB_COMMIT_INTERVAL, "1000", PARM_SRC_CHGPARMS), 0);
  p = srv({"x", "QFULL_NUM_RETRIES=7", "RN=5", "COMMIT_INTERVAL=2000"});
  ASSERT_EQ(p.rc, 0) << p.out;
  EXPECT_EQ(server_->getParmInt(XQPUB_QFULL_NUM_RETRIES), 7);
  EXPECT_EQ(server_->getParmInt(XQPUB_COMMIT_INTERVAL), 1000);
  EXPECT_EQ(server_->getParmSource(XQPUB_COMMIT_INTERVAL), PARM_SRC_CHGPARMS);
}

TEST_F(ParmSetTest, ServerRuleRefusals) {
  // Argument, message id and a text the message must show.
  const char* cases[][3] = {{"qmgr=QM1", "KLP0504E", ""},
                            {"STARTMODE=warm", "KLP0500E", "STARTMODE"},
                            {"COMMIT_INTERVAL=12abc", "KLP0500E", ""},
                            {"COMMIT_INTERVAL=99999999999", "KLP0503E", ""},
                            {"COMMIT_INTERVAL=99999999999999999999", "KLP0503E", ""},
                            {"COMMIT_INTERVAL=50", "KLP0503E", ""},
                            {"COMMIT_INTERVAL=", "KLP0500E", ""},
                            {"COMMIT_INTERVAL", "KLP0504E", ""}};
  for (const auto& c : cases) {
    Parsed p = newSrv({"x", c[0]});
    EXPECT_EQ(p.rc, KLP_RC_BAD_PARM) << c[0];
    EXPECT_TRUE(p.has(c[1]) && p.has(c[2])) << c[0] << ":\n" << p.out;
  }
}

}  // namespace
