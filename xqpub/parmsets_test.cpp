// The two parameter sets: every row of both tables (against a golden file),
// and each set's command-line rule as (arguments) -> rc, the records logged,
// and what was stored.
#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <memory>
#include <string>
#include <vector>

#include "tests/testing/klptest.h"
#include "xqpub/kcapcmdparms.h"
#include "xqpub/xqpubparms.h"

namespace {

using Records = std::vector<std::string>;

// Fresh parameter objects as a new run of klpkccmd has them, and a logger
// that keeps what is issued.
class ParmSetTest : public ::testing::Test {
 protected:
  void SetUp() override { reset(); }
  void reset() {
    ParmEntry ct[KCAPCMD_PARM_COUNT], st[XQPUB_PARM_COUNT];
    buildKCapCmdParmTable(ct);
    buildXqpubParmTable(st);
    int rcCmd = -1, rcSrv = -1;
    cmd_ = std::make_unique<kCapCmdParmClass>(ct, KCAPCMD_PARM_COUNT, &rcCmd);
    server_ = std::make_unique<xqpubParms>(st, XQPUB_PARM_COUNT, &rcSrv);
    ASSERT_EQ(rcCmd + rcSrv, 0);
    cmd_->setServerParms(server_.get());
    cmd_->setUsageText(kCapCmdUsageText);
    klpSetCurrentParms(cmd_.get());
    log_.take();
  }
  static int run(klpParmClass* p, std::vector<std::string> args) {
    unsetenv("ORACLE_SID");
    args.insert(args.begin(), "klpkccmd");
    std::vector<char*> argv;
    for (auto& a : args) argv.push_back(a.data());
    return p->processCommandLine(static_cast<int>(args.size()), argv.data());
  }

  klptest::ProcessLogger log_;
  std::unique_ptr<kCapCmdParmClass> cmd_;
  std::unique_ptr<xqpubParms> server_;
};

// One line per slot of the command table, then of the server table ("index
// name type minimum..maximum m<match length> d<display> c<changeable>
// "default""), the QRYPARMS printout of the server's defaults (the message
// a server sends, printed by the command set), and the usage text.
TEST_F(ParmSetTest, BothTablesTheQueryOfTheDefaultsAndTheUsageMatchTheGoldenFile) {
  static const char* const types[] = {"INTEGER", "BOOLEAN", "STRING", "COMMAND", "PLACEHOLDER"};
  std::string got;
  for (const klpParmClass* p : {static_cast<klpParmClass*>(cmd_.get()),
                                static_cast<klpParmClass*>(server_.get())}) {
    for (int i = 0; i < p->getCount(); ++i) {
      const ParmEntry* s = p->peekSlot(i);
      std::string v = s->type == PARM_INTEGER   ? std::to_string(s->intValue)
                      : s->type == PARM_BOOLEAN ? (s->boolValue ? "Y" : "N")
                                                : s->strValue;
      char line[200];
      snprintf(line, sizeof line, "%d %s %s %d..%d m%d d%d c%d \"%s\"\n", s->index, s->name,
               types[s->type], s->minimum, s->maximum, s->matchLength, s->display, s->changeable,
               v.c_str());
      got += line;
    }
  }
  std::vector<uint8_t> msg(server_->getQueryMsgSize());
  ASSERT_EQ(server_->setQueryMsg(msg.data()), 0);
  ASSERT_EQ(cmd_->getQueryMsg(msg.data(), msg.size()), 0);
  for (const std::string& r : log_.take()) got += r + "\n";
  got += kCapCmdUsageText;
  EXPECT_EQ(cmd_->getQueryMsgSize(), 10u);  // the command set sends nothing of its own

  EXPECT_EQ(got, klptest::readFile(KLP_SOURCE_DIR "/xqpub/parmtables.golden"));
}

// kCapCmdParmClass::processCommandLine: the pairs after CHGPARMS, the rules
// that end that group, the leading server word and exactly one command.
TEST_F(ParmSetTest, CommandSetRuleAndItsRecords) {
  const std::string w = "<kCapCmdParmClass::processComma> ", d1039(1039, '1'), d1040(1040, '1'),
                    failed = "589 " + w + "1: kCapCmdParmClass::processCommandLine|",
                    parse = failed + "2002|parseCmdLine";
  // pending: "index=value ..."; after: "server schema command:text", "" when
  // not looked at.
  struct { std::vector<std::string> args; int rc; Records logged; std::string pending, after; } cases[] = {
      {{"CAPTURE_SERVER=x", "CHGPARMS", "COMMIT_INTERVAL=1000", "SLEEP_INTERVAL=200",
        "qfull_numbers=5", "COMMIT_INTERVAL=2000", "LOGSTDOUT=y"},
       0, {}, "30=2000 16=200 37=5 4=y", "X KLP 20:"},
      {{"X", "CHGPARMS", "COMMIT_INTERVAL=50"}, 2002, {"519 " + w + "35: 50|COMMIT_INTERVAL"}, "", ""},
      {{"X", "CHGPARMS", "COMMIT_INTERVAL=1000", "qfull_n=1001"}, 2002,
       {"519 " + w + "35: 1001|QFULL_N"}, "30=1000", ""},
      {{"X", "CHGPARMS", "TERM=maybe"}, 2002, {"519 " + w + "35: maybe|TERM"}, "", ""},
      {{"X", "CHGPARMS", "TERM"}, 2002, {"519 " + w + "35: |TERM"}, "", ""},
      {{"X", "CHGPARMS", "QFULL_RETRY_DELAY=" + d1039}, 2002,
       {"519 " + w + "35: " + d1039 + "|QFULL_RETRY_DELAY"}, "", ""},
      // What ends the group is an ordinary argument again: the command's own
      // schema, a second command, or no parameter of the command set at all.
      {{"X", "CHGPARMS", "CAPTURE_SCHEMA=KLP1"}, 2002, {"527 " + w + "35:"}, "", "X KLP1 20:"},
      {{"X", "CHGPARMS", "COMMIT_INTERVAL=1000", "STOP"}, 2002,
       {"518 <klpParmClass::parseCmdLine> 1:", parse}, "30=1000", ""},
      {{"X", "CHGPARMS", "TERM=Y", "STARTMODE=COLD"}, 2002, {"504 " + w + "1: STARTMODE=COLD"}, "5=Y", ""},
      {{"X", "CHGPARMS", "QFULL_RETRY_DELAY=" + d1040}, 2002,
       {"504 " + w + "1: QFULL_RETRY_DELAY=" + d1040}, "", ""},
      {{"X", "CHGPARMS", std::string(33, 'K') + "=1"}, 2002,
       {"504 " + w + "1: " + std::string(33, 'K') + "=1"}, "", ""},
      {{"X", "CHGPARMS"}, 2002, {"527 " + w + "35:"}, "", ""},
      // The server: a leading word, a keyword, or ORACLE_SID.
      {{"CAPTURE_SCHEMA=S", "STOP"}, 2003, {"524 <klpParmClass::getPositionalDBN> 1: CAPTURE_SERVER",
                                            failed + "2003|getPositionalDBName"}, "", ""},
      {{"STATUS"}, 2002, {"526 " + w + "35:"}, "", "STATUS KLP -1:"},
      {{"mydb", "capture_server=other", "SUSPEND"}, 0, {}, "", "OTHER KLP 19:"},
      {{"KLPPLACEHOLDER", "STOP"}, 2002,
       {"504 <klpParmClass:preCmdLine> 35: KLPPLACEHOLDER", failed + "2002|preCmdLine"}, "", ""},
      // Command words and their arguments; only the words of this set.
      {{"x", "reinitq=Q.One", "DEBUG"}, 0, {}, "", "X KLP 23:Q.One"},
      {{"x", "RESUME", "LOGSTDOUT"}, 0, {}, "", "X KLP 18:"},
      {{"x", "FOO=1", "STOP"}, 2002, {"504 " + w + "1: FOO=1"}, "", ""},
      {{"x", "?"}, 2002, {"504 " + w + "1: ?"}, "", ""},
      {{"x", "LOGSTDOUT"}, 2002, {"526 " + w + "35:"}, "", ""},
  };
  for (const auto& c : cases) {
    reset();
    SCOPED_TRACE(&c - cases);
    EXPECT_EQ(run(cmd_.get(), c.args), c.rc);
    EXPECT_EQ(log_.take(), c.logged);
    std::string pending, after;
    for (int i = 0; i < cmd_->getChgParmsCount(); ++i)
      pending += (i ? " " : "") + std::to_string(cmd_->getChgParmsEntry(i)->index) + "=" +
                 cmd_->getChgParmsEntry(i)->value;
    EXPECT_EQ(pending, c.pending);
    int named = cmd_->getNamedCommand();
    after = cmd_->getParmString(0) + (" " + std::string(cmd_->getParmString(2))) + " " +
            std::to_string(named) + ":" + (named < 0 ? "" : cmd_->getCommandText(named));
    EXPECT_TRUE(c.after.empty() || c.after == after) << after;
    // The server set is only consulted.
    EXPECT_EQ(server_->getParmSource(XQPUB_COMMIT_INTERVAL) + server_->getParmSource(4), 0);
  }
}

// xqpubParms::processCommandLine: queue names refused, STARTMODE checked,
// short forms standing for their long forms.
TEST_F(ParmSetTest, ServerSetRuleAndItsRecords) {
  const std::string w = "<xqpubParms::processCommandLine> 1: ", failed = "589 " + w + "xqpubParms::processCommandLine|";
  // after: STARTMODE and the two pairs of short and long forms.
  struct { std::vector<std::string> args; int rc; Records logged; std::string after; } cases[] = {
      {{"x", "STARTMODE=cold", "RN=5", "RD=20", "TRANSID=abc"}, 0, {}, "COLD 5@2 20@2 abc@2"},
      {{"x", "STARTMODE=warmns", "QFULL_NUM_RETRIES=7", "RN=5", "IGNORE_TRANSID=i", "TRANSID=t"},
       0, {}, "WARMNS 7@2 250@0 i@2"},
      {{"x", "STARTMODE=warm", "RN=5"}, 2002, {"500 " + w + "WARM|STARTMODE"}, "WARM 5@2 250@0 @0"},
      {{"x", "qmgr=QM1"}, 2002, {"504 " + w + "qmgr=QM1"}, "WARMSI 30@0 250@0 @0"},
      {{"x", "Adminq=A"}, 2002, {"504 " + w + "Adminq=A"}, ""},
      {{"RESTARTQ=R", "x"}, 2002, {"504 " + w + "RESTARTQ=R"}, ""},
      {{"x", "QMGRX=1"}, 2002, {"504 <klpParmClass::parseCmdLine> 1: QMGRX=1", failed + "2002|parseCmdLine"}, ""},
      {{"CAPTURE_PATH=/"}, 2003, {"524 <klpParmClass::getPositionalDBN> 1: CAPTURE_SERVER",
                                  failed + "2003|getPositionalDBName"}, ""},
  };
  for (const auto& c : cases) {
    reset();
    SCOPED_TRACE(&c - cases);
    EXPECT_EQ(run(server_.get(), c.args), c.rc);
    EXPECT_EQ(log_.take(), c.logged);
    std::string after = server_->getParmString(XQPUB_STARTMODE);
    for (int i : {XQPUB_QFULL_NUM_RETRIES, XQPUB_QFULL_RETRY_DELAY, XQPUB_IGNORE_TRANSID})
      after += " " + (i == XQPUB_IGNORE_TRANSID ? server_->getParmString(i)
                                                 : std::to_string(server_->getParmInt(i))) +
               "@" + std::to_string(server_->getParmSource(i));
    EXPECT_TRUE(c.after.empty() || c.after == after) << after;
  }
}

}  // namespace
