// The two parameter sets: both tables against a golden file, each set's command line as rc, records, what is kept.
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

// Fresh parameter objects as a new run of klpkccmd has them, and a recording logger.
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

// Each slot of both tables, the query printout of the server's defaults, the usage text.
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

// Command set: CHGPARMS pairs and their end, the server, one command; server set: queues, STARTMODE, short forms.
TEST_F(ParmSetTest, CommandLineRulesAndTheirRecords) {
  const std::string w = "<kCapCmdParmClass::processComma> ", d1039(1039, '1'), d1040(1040, '1'),
                    bad = "519 " + w + "35: ", odd = "504 " + w + "1: ", k33 = std::string(33, 'K') + "=1",
                    failed = "589 " + w + "1: kCapCmdParmClass::processCommandLine|",
                    parse = failed + "2002|parseCmdLine", sw = "<xqpubParms::processCommandLine> 1: ",
                    sfailed = "589 " + sw + "xqpubParms::processCommandLine|";
  // after: "pairs;server schema command:text", or STARTMODE and short/long forms with their sources.
  struct { bool server; std::vector<std::string> args; int rc; Records logged; std::string after; } cases[] = {
      {0, {"CAPTURE_SERVER=x", "CHGPARMS", "COMMIT_INTERVAL=1000", "SLEEP_INTERVAL=200",
        "qfull_numbers=5", "COMMIT_INTERVAL=2000", "LOGSTDOUT=y"}, 0, {}, "30=2000 16=200 37=5 4=y;X KLP 20:"},
      {0, {"X", "CHGPARMS", "COMMIT_INTERVAL=50"}, 2002, {bad + "50|COMMIT_INTERVAL"}, ";"},
      {0, {"X", "CHGPARMS", "COMMIT_INTERVAL=1000", "qfull_n=1001"}, 2002, {bad + "1001|QFULL_N"}, "30=1000;"},
      {0, {"X", "CHGPARMS", "TERM=maybe"}, 2002, {bad + "maybe|TERM"}, ";"},
      {0, {"X", "CHGPARMS", "TERM"}, 2002, {bad + "|TERM"}, ";"},
      {0, {"X", "CHGPARMS", "QFULL_RETRY_DELAY=" + d1039}, 2002, {bad + d1039 + "|QFULL_RETRY_DELAY"}, ";"},
      // Ends of the group: the command's own schema, a second command, a word of no set.
      {0, {"X", "CHGPARMS", "CAPTURE_SCHEMA=KLP1"}, 2002, {"527 " + w + "35:"}, ";X KLP1 20:"},
      {0, {"X", "CHGPARMS", "COMMIT_INTERVAL=1000", "STOP"}, 2002,
       {"518 <klpParmClass::parseCmdLine> 1:", parse}, "30=1000;"},
      {0, {"X", "CHGPARMS", "TERM=Y", "STARTMODE=COLD"}, 2002, {odd + "STARTMODE=COLD"}, "5=Y;"},
      {0, {"X", "CHGPARMS", "QFULL_RETRY_DELAY=" + d1040}, 2002, {odd + "QFULL_RETRY_DELAY=" + d1040}, ";"},
      {0, {"X", "CHGPARMS", k33}, 2002, {odd + k33}, ";"},
      {0, {"X", "CHGPARMS"}, 2002, {"527 " + w + "35:"}, ";"},
      // The server: a leading word, a keyword, or ORACLE_SID.
      {0, {"CAPTURE_SCHEMA=S", "STOP"}, 2003, {"524 <klpParmClass::getPositionalDBN> 1: CAPTURE_SERVER",
                                               failed + "2003|getPositionalDBName"}, ";"},
      {0, {"STATUS"}, 2002, {"526 " + w + "35:"}, ";STATUS KLP -1:"},
      {0, {"mydb", "capture_server=other", "SUSPEND"}, 0, {}, ";OTHER KLP 19:"},
      {0, {"KLPPLACEHOLDER", "STOP"}, 2002, {"504 <klpParmClass:preCmdLine> 35: KLPPLACEHOLDER",
                                           failed + "2002|preCmdLine"}, ";"},
      // Command words and their arguments; only the words of this set.
      {0, {"x", "reinitq=Q.One", "DEBUG"}, 0, {}, ";X KLP 23:Q.One"},
      {0, {"x", "RESUME", "LOGSTDOUT"}, 0, {}, ";X KLP 18:"},
      {0, {"x", "FOO=1", "STOP"}, 2002, {odd + "FOO=1"}, ";"},
      {0, {"x", std::string(32, 'K') + "=1"}, 2002, {odd + std::string(32, 'K') + "=1"}, ";"},  // a keyword's longest
      {0, {"x", "?"}, 2002, {odd + "?"}, ";"},
      {0, {"x", "LOGSTDOUT"}, 2002, {"526 " + w + "35:"}, ";"},
      {1, {"x", "STARTMODE=cold", "RN=5", "RD=20", "TRANSID=abc"}, 0, {}, "COLD 5@2 20@2 abc@2"},
      {1, {"x", "STARTMODE=warmns", "QFULL_NUM_RETRIES=7", "RN=5", "IGNORE_TRANSID=i", "TRANSID=t"},
       0, {}, "WARMNS 7@2 250@0 i@2"},
      {1, {"x", "STARTMODE=warm", "RN=5"}, 2002, {"500 " + sw + "WARM|STARTMODE"}, "WARM 5@2 250@0 @0"},
      {1, {"x", "qmgr=QM1"}, 2002, {"504 " + sw + "qmgr=QM1"}, "WARMSI 30@0 250@0 @0"},
      {1, {"x", "Adminq=A"}, 2002, {"504 " + sw + "Adminq=A"}, ""},
      {1, {"RESTARTQ=R", "x"}, 2002, {"504 " + sw + "RESTARTQ=R"}, ""},
      {1, {"x", "QMGRX=1"}, 2002, {"504 <klpParmClass::parseCmdLine> 1: QMGRX=1",
                                    sfailed + "2002|parseCmdLine"}, ""},
      {1, {"CAPTURE_PATH=/"}, 2003, {"524 <klpParmClass::getPositionalDBN> 1: CAPTURE_SERVER",
                                     sfailed + "2003|getPositionalDBName"}, ""},
  };
  for (const auto& c : cases) {
    reset();
    SCOPED_TRACE(&c - cases);
    EXPECT_EQ(run(c.server ? static_cast<klpParmClass*>(server_.get()) : cmd_.get(), c.args), c.rc);
    EXPECT_EQ(log_.take(), c.logged);
    std::string after;
    if (c.server) {
      after = server_->getParmString(XQPUB_STARTMODE);
      for (int i : {XQPUB_QFULL_NUM_RETRIES, XQPUB_QFULL_RETRY_DELAY, XQPUB_IGNORE_TRANSID})
        after += " " + (i == XQPUB_IGNORE_TRANSID ? server_->getParmString(i) : std::to_string(server_->getParmInt(i))) +
                 "@" + std::to_string(server_->getParmSource(i));
    } else {
      for (int i = 0; i < cmd_->getChgParmsCount(); ++i) {
        const auto* e = cmd_->getChgParmsEntry(i);
        after += (i ? " " : "") + std::to_string(e->index) + "=" + e->value;
      }
      int named = cmd_->getNamedCommand();
      after += std::string(";") + cmd_->getParmString(0) + " " + cmd_->getParmString(2) + " " + std::to_string(named) +
               ":" + (named < 0 ? "" : cmd_->getCommandText(named));
      EXPECT_EQ(server_->getParmSource(XQPUB_COMMIT_INTERVAL) + server_->getParmSource(4), 0);  // only consulted
    }
    // An empty or ";"-ended expectation leaves the rest unlooked at.
    EXPECT_TRUE(c.after == after || (after.rfind(c.after, 0) == 0 && (c.after.empty() || c.after.back() == ';')))
        << after;
  }
}

}  // namespace
