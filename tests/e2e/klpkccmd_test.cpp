// The command program against the sample server: real processes, each test
// under its own TMPDIR, nothing left behind.
#include <signal.h>

#include <memory>
#include <sstream>
#include <string>
#include <vector>

#include "common/platform/hsv.h"
#include "tests/e2e/e2e_support.h"

using e2e::Server;

namespace {

struct CmdRun {
  klptest::ProcessResult r;
  int pid = 0;
};

// Runs klpkccmd against `server` and checks that its reply queue is gone.
CmdRun klpkccmd(const klptest::TmpDir& dir, const std::string& server,
                const std::vector<std::string>& args, int timeoutMs = 90000) {
  std::vector<std::string> argv = {klptest::binPath("klpkccmd"), "CAPTURE_SERVER=" + server};
  argv.insert(argv.end(), args.begin(), args.end());
  klptest::Background b(argv);
  CmdRun run;
  run.pid = b.pid();
  run.r = b.wait(timeoutMs);
  EXPECT_FALSE(klptest::queueExists(e2e::replyQueuePath(dir, server, run.pid)))
      << "reply queue of " << args[0] << " left behind";
  return run;
}

std::string all(const CmdRun& c) { return c.r.out + c.r.err; }

void stopServer(const klptest::TmpDir& dir, Server& s, const std::string& name) {
  CmdRun stop = klpkccmd(dir, name, {"STOP"});
  EXPECT_EQ(stop.r.exitCode, 0) << all(stop);
  // Whatever STOP did, the server goes and takes its queue with it.
  if (stop.r.exitCode != 0) s.proc().kill(SIGTERM);
  EXPECT_EQ(s.proc().wait(30000).exitCode, 0) << s.log();
  EXPECT_FALSE(klptest::queueExists(s.queue()));
}

std::vector<std::string> lines(const std::string& text) {
  std::vector<std::string> out;
  std::istringstream in(text);
  for (std::string l; std::getline(in, l);) out.push_back(l);
  return out;
}

}  // namespace

TEST(Klpkccmd, EveryCommandWordSucceedsAgainstARunningServer) {
  klptest::TmpDir dir;
  Server s(dir, "ALL");
  ASSERT_TRUE(s.ready());
  const std::vector<std::vector<std::string>> commands = {
      {"STATUS"},  {"QRYPARMS"},         {"CHGPARMS", "COMMIT_INTERVAL=900"},
      {"PRUNE"},   {"REINIT"},           {"REINITQ=SENDQ1"},
      {"STARTQ"},  {"STARTQ=SENDQ1"},    {"STOPQ=SENDQ1"},
      {"SUSPEND"}, {"RESUME"},           {"TRCSTART"},
      {"STATUS", "SHOW", "DETAILS"}};
  for (const auto& args : commands) {
    CmdRun c = klpkccmd(dir, "ALL", args);
    EXPECT_EQ(c.r.exitCode, 0) << args[0] << "\n" << all(c);
  }
  CmdRun st = klpkccmd(dir, "ALL", {"STATUS"});
  EXPECT_EQ(e2e::countOf(all(st), "KLP0520I"), 4u) << all(st);
  EXPECT_NE(all(st).find("WorkerThread"), std::string::npos);
  std::string log = s.log();
  EXPECT_TRUE(e2e::waitFor([&] { return s.log().find("SENDQ1") != std::string::npos; }, 5000))
      << log;
  stopServer(dir, s, "ALL");
}

TEST(Klpkccmd, DetailedStatusReportLinesUpItsEqualSigns) {
  klptest::TmpDir dir;
  Server s(dir, "DETAILS");
  ASSERT_TRUE(s.ready());
  CmdRun c = klpkccmd(dir, "DETAILS", {"STATUS", "SHOW", "DETAILS"});
  ASSERT_EQ(c.r.exitCode, 0) << all(c);
  size_t column = std::string::npos;
  int rows = 0;
  std::string logLine;
  for (const std::string& l : lines(c.r.out)) {
    size_t eq = l.find(" = ");
    if (eq == std::string::npos) continue;
    ++rows;
    if (column == std::string::npos) column = eq;
    EXPECT_EQ(eq, column) << l;
    EXPECT_EQ(l.rfind("  ", 0), 0u) << l;
    EXPECT_EQ(l[eq - 1], ')') << l;
    if (l.find("(LOGFILE)") != std::string::npos) logLine = l;
  }
  EXPECT_EQ(rows, 9) << c.r.out;
  EXPECT_EQ(logLine.substr(column + 3), e2e::logPath(dir, "DETAILS"));
  for (const char* key : {"(SERVER) = DETAILS", "(SCHEMA) = KLP", "(UP_TIME) = ",
                          "(CURRENT_MEMORY ) = ", "(ACTIVE_KSUBS) = 0"})
    EXPECT_NE(c.r.out.find(key), std::string::npos) << key << "\n" << c.r.out;
  stopServer(dir, s, "DETAILS");
}

TEST(Klpkccmd, ChgparmsOfTwoParametersShowsInQryparmsWithItsSource) {
  klptest::TmpDir dir;
  Server s(dir, "CHGP");
  ASSERT_TRUE(s.ready());
  CmdRun chg = klpkccmd(dir, "CHGP", {"CHGPARMS", "COMMIT_INTERVAL=1000", "SLEEP_INTERVAL=200"});
  ASSERT_EQ(chg.r.exitCode, 0) << all(chg);
  EXPECT_EQ(e2e::countOf(all(chg), "KLP0523I"), 2u) << all(chg);
  EXPECT_NE(all(chg).find("COMMIT_INTERVAL"), std::string::npos);
  EXPECT_NE(all(chg).find("SLEEP_INTERVAL"), std::string::npos);

  CmdRun q = klpkccmd(dir, "CHGP", {"QRYPARMS"});
  ASSERT_EQ(q.r.exitCode, 0) << all(q);
  bool commit = false, sleep = false;
  for (const std::string& l : lines(all(q))) {
    if (l.find("COMMIT_INTERVAL") != std::string::npos) {
      commit = true;
      EXPECT_NE(l.find("1000"), std::string::npos) << l;
      EXPECT_NE(l.find("CHGPARMS COMMAND"), std::string::npos) << l;
    }
    if (l.find("\"SLEEP_INTERVAL\"") != std::string::npos) {
      sleep = true;
      EXPECT_NE(l.find("200"), std::string::npos) << l;
      EXPECT_NE(l.find("CHGPARMS COMMAND"), std::string::npos) << l;
    }
  }
  EXPECT_TRUE(commit && sleep) << all(q);
  stopServer(dir, s, "CHGP");
}

TEST(Klpkccmd, EightClientsAtOnceEachGetTheirOwnReplies) {
  klptest::TmpDir dir;
  Server s(dir, "MANY");
  ASSERT_TRUE(s.ready());
  std::vector<std::unique_ptr<klptest::Background>> clients;
  for (int i = 0; i < 8; ++i) {
    std::vector<std::string> argv = {klptest::binPath("klpkccmd"), "CAPTURE_SERVER=MANY",
                                     i % 2 ? "QRYPARMS" : "STATUS"};
    clients.push_back(std::make_unique<klptest::Background>(argv));
  }
  for (int i = 0; i < 8; ++i) {
    int pid = clients[i]->pid();
    klptest::ProcessResult r = clients[i]->wait(90000);
    std::string out = r.out + r.err;
    EXPECT_EQ(r.exitCode, 0) << out;
    if (i % 2) {
      EXPECT_EQ(e2e::countOf(out, "KLP0520I"), 0u) << out;
      EXPECT_NE(out.find("COMMIT_INTERVAL"), std::string::npos) << out;
    } else {
      EXPECT_EQ(e2e::countOf(out, "KLP0520I"), 4u) << out;
      EXPECT_EQ(out.find("COMMIT_INTERVAL"), std::string::npos) << out;
    }
    EXPECT_FALSE(klptest::queueExists(e2e::replyQueuePath(dir, "MANY", pid)));
  }
  stopServer(dir, s, "MANY");
}

TEST(Klpkccmd, WithoutAServerItGivesUpAfterFiveAttempts) {
  klptest::TmpDir dir;
  CmdRun c = klpkccmd(dir, "NOBODY", {"STOP"});
  EXPECT_EQ(c.r.exitCode, 12) << all(c);
  EXPECT_NE(all(c).find("KLP0506E"), std::string::npos) << all(c);
  EXPECT_NE(all(c).find("KLP0597E"), std::string::npos) << all(c);
  EXPECT_NE(all(c).find(e2e::serverQueuePath(dir, "NOBODY")), std::string::npos) << all(c);
  EXPECT_FALSE(klptest::queueExists(e2e::serverQueuePath(dir, "NOBODY")));
}

// When the detailed status cannot be had, the short report says so without
// claiming the server is up, and the run ends with 12.
TEST(Klpkccmd, DetailedStatusThatCannotBeHadGivesTheShortReport) {
  klptest::TmpDir dir;
  const struct {
    std::string server;
    const char* code;  // the failure the step report names
  } cases[] = {
      {"NOBODY", "\"2013\""},
      // Cut to the request's 128 characters it would name another server.
      {std::string(140, 'L'), "\"2009\""},
  };
  for (const auto& c : cases) {
    CmdRun run = klpkccmd(dir, c.server, {"STATUS", "SHOW", "DETAILS"});
    EXPECT_EQ(run.r.exitCode, 12) << all(run);
    EXPECT_EQ(e2e::countOf(run.r.out, " = "), 3u) << run.r.out;
    EXPECT_NE(run.r.out.find("(SERVER) = " + c.server + "\n"), std::string::npos) << run.r.out;
    EXPECT_NE(run.r.out.find("(STATUS) = Unknown: the detailed status could not be obtained\n"),
              std::string::npos) << run.r.out;
    EXPECT_NE(all(run).find(c.code), std::string::npos) << all(run);
  }
}

TEST(Klpkccmd, AServerKilledBeforeItAnswersEndsInNoReply) {
  klptest::TmpDir dir;
  {
    Server s(dir, "GONE");
    ASSERT_TRUE(s.ready());
    s.proc().kill(SIGKILL);
    s.proc().wait(10000);
  }
  // The dead server's queue still takes the request; nobody answers it.
  ASSERT_TRUE(klptest::queueExists(e2e::serverQueuePath(dir, "GONE")));
  CmdRun c = klpkccmd(dir, "GONE", {"STATUS"});
  EXPECT_EQ(c.r.exitCode, 12) << all(c);
  EXPECT_NE(all(c).find("KLP0510"), std::string::npos) << all(c);
  e2e::destroyQueue(e2e::serverQueuePath(dir, "GONE"));
  EXPECT_FALSE(klptest::queueExists(e2e::serverQueuePath(dir, "GONE")));
}

TEST(Klpkccmd, InterruptedWhileWaitingItDestroysItsReplyQueue) {
  klptest::TmpDir dir;
  Server s(dir, "INTR");
  ASSERT_TRUE(s.ready());
  s.proc().kill(SIGSTOP);  // the server takes nothing while stopped
  klptest::Background client(
      {klptest::binPath("klpkccmd"), "CAPTURE_SERVER=INTR", "STATUS"});
  std::string reply = e2e::replyQueuePath(dir, "INTR", client.pid());
  EXPECT_TRUE(e2e::waitFor([&] { return klptest::queueExists(reply); }, 20000));
  // Signal it once its request is on the server's queue, that is while it
  // waits: a jump out of the middle of issuing a message would abandon that
  // message's memory, which the leak checker reports.
  HSVResID sid;
  ASSERT_EQ(hsvIPCGetQueResID(s.queue().c_str(), HSV_QUEUE_RESID_OPTION, &sid), ECF_OK);
  HSVHIPCQueue serverQueue;
  ASSERT_EQ(serverQueue.attach(sid), ECF_OK);
  EXPECT_TRUE(e2e::waitFor([&] { return serverQueue.hasMessage(); }, 20000));
  serverQueue.detach();
  client.kill(SIGINT);
  klptest::ProcessResult r = client.wait(30000);
  EXPECT_EQ(r.exitCode, 12) << r.out << r.err;
  // Back at the recovery point: the signal is reported and the run ends.
  EXPECT_NE(r.out.find("SIGINT"), std::string::npos) << r.out;
  EXPECT_NE(r.out.find("\"setRecoveryPoint\""), std::string::npos) << r.out;
  EXPECT_FALSE(klptest::queueExists(reply));
  s.proc().kill(SIGCONT);
  stopServer(dir, s, "INTR");
}

TEST(Klpkccmd, AServerStartedAgainAfterSigkillAnswers) {
  klptest::TmpDir dir;
  {
    Server first(dir, "AGAIN");
    ASSERT_TRUE(first.ready());
    first.proc().kill(SIGKILL);
    first.proc().wait(10000);
  }
  Server second(dir, "AGAIN", {"LOGSTDOUT"});
  ASSERT_TRUE(e2e::waitFor([&] { return e2e::countOf(second.log(), "KLP0594I") == 2; }, 20000))
      << second.log() << second.proc().out() << second.proc().err();
  std::string out = second.proc().out();
  size_t a = out.find("KLP0592I"), d = out.find("KLP0595I"), c = out.find("KLP0594I");
  ASSERT_NE(a, std::string::npos) << out;
  EXPECT_LT(a, d);
  EXPECT_LT(d, c);
  CmdRun st = klpkccmd(dir, "AGAIN", {"STATUS"});
  EXPECT_EQ(st.r.exitCode, 0) << all(st);
  stopServer(dir, second, "AGAIN");
}
