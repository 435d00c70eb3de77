// The command program against the sample server: real processes, each test
// under its own TMPDIR, nothing left behind.
#include <signal.h>
#include <sys/resource.h>

#include <chrono>
#include <memory>
#include <string>
#include <vector>

#include "common/platform/hsv.h"
#include "tests/e2e/e2e_support.h"

using e2e::Server;

namespace {

// klpkccmd against `server`, running in the background.
std::unique_ptr<klptest::Background> start(const std::string& server, std::vector<std::string> args) {
  args.insert(args.begin(), {klptest::binPath("klpkccmd"), "CAPTURE_SERVER=" + server});
  return std::make_unique<klptest::Background>(args);
}

// Runs klpkccmd to its end; its reply queue must be gone then.
klptest::ProcessResult klpkccmd(const klptest::TmpDir& dir, const std::string& server,
                                const std::vector<std::string>& args) {
  auto b = start(server, args);
  klptest::ProcessResult r = b->wait(90000);
  EXPECT_FALSE(klptest::queueExists(e2e::replyQueuePath(dir, server, b->pid()))) << args[0];
  r.out += r.err;
  return r;
}

void stopServer(const klptest::TmpDir& dir, Server& s, const std::string& name) {
  klptest::ProcessResult stop = klpkccmd(dir, name, {"STOP"});
  EXPECT_EQ(stop.exitCode, 0) << stop.out;
  if (stop.exitCode != 0) s.proc().kill(SIGTERM);
  EXPECT_EQ(s.proc().wait(30000).exitCode, 0) << s.log();
  EXPECT_FALSE(klptest::queueExists(s.queue()));
}

}  // namespace

TEST(Klpkccmd, EveryCommandWordSucceedsAgainstARunningServer) {
  klptest::TmpDir dir;
  Server s(dir, "ALL");
  ASSERT_TRUE(s.ready());
  const std::vector<std::vector<std::string>> commands = {
      {"STATUS"},       {"PRUNE"},        {"REINIT"},  {"REINITQ=SENDQ1"}, {"STARTQ"}, {"STARTQ=SENDQ1"},
      {"STOPQ=SENDQ1"}, {"SUSPEND"},      {"RESUME"},  {"TRCSTART"},       {"STATUS", "SHOW", "DETAILS"},
      {"CHGPARMS", "COMMIT_INTERVAL=1000", "SLEEP_INTERVAL=200"},          {"QRYPARMS"}};
  for (const auto& args : commands) {
    klptest::ProcessResult c = klpkccmd(dir, "ALL", args);
    EXPECT_EQ(c.exitCode, 0) << args[0] << "\n" << c.out;
    if (args[0] == "CHGPARMS") { EXPECT_EQ(e2e::countOf(c.out, "KLP0523I"), 2u) << c.out; }
    for (const char* want : {"\"COMMIT_INTERVAL\" has the value \"1000\" from \"CHGPARMS COMMAND\"",
                             "\"SLEEP_INTERVAL\" has the value \"200\" from \"CHGPARMS COMMAND\""})
      EXPECT_EQ(c.out.find(want) != std::string::npos, args[0] == "QRYPARMS") << want << "\n" << c.out;
    if (args.size() == 3 && args[1] == "SHOW") {  // the detailed report: nine rows, the log file from the server
      EXPECT_EQ(e2e::countOf(c.out, " = "), 9u) << c.out;
      EXPECT_NE(c.out.find("(LOGFILE) = " + e2e::logPath(dir, "ALL") + "\n"), std::string::npos) << c.out;
    } else if (args[0] == "STATUS") {
      EXPECT_EQ(e2e::countOf(c.out, "KLP0520I"), 4u) << c.out;
    }
  }
  EXPECT_TRUE(e2e::waitFor([&] { return s.log().find("SENDQ1") != std::string::npos; }, 5000)) << s.log();
  // The detailed status was answered by a thread through the reply sender.
  EXPECT_NE(s.log().find("<KLPResponseFunc> KLP0592I"), std::string::npos) << s.log();
  stopServer(dir, s, "ALL");
}

TEST(Klpkccmd, EightClientsAtOnceEachGetTheirOwnReplies) {
  klptest::TmpDir dir;
  Server s(dir, "MANY");
  ASSERT_TRUE(s.ready());
  std::vector<std::unique_ptr<klptest::Background>> clients;
  for (int i = 0; i < 8; ++i) clients.push_back(start("MANY", {i % 2 ? "QRYPARMS" : "STATUS"}));
  for (int i = 0; i < 8; ++i) {
    klptest::ProcessResult r = clients[i]->wait(90000);
    std::string out = r.out + r.err;
    EXPECT_EQ(r.exitCode, 0) << out;
    EXPECT_EQ(e2e::countOf(out, "KLP0520I"), i % 2 ? 0u : 4u) << out;
    EXPECT_EQ(out.find("COMMIT_INTERVAL") != std::string::npos, i % 2 == 1) << out;
    EXPECT_FALSE(klptest::queueExists(e2e::replyQueuePath(dir, "MANY", clients[i]->pid())));
  }
  stopServer(dir, s, "MANY");
}

// Without a server the attach is tried five times (8 s, waited for once
// here, by both runs at once). STATUS then fails with 12 like any other
// command; the detailed status gives the short report without claiming the
// server is up.
TEST(Klpkccmd, WithoutAServerStatusEndsWith12) {
  klptest::TmpDir dir;
  auto began = std::chrono::steady_clock::now();
  auto status = start("NOBODY", {"STATUS"});
  auto details = start("NOBODY", {"STATUS", "SHOW", "DETAILS"});
  const std::string longName(140, 'L');  // cut to the request's 128 it would name another server
  klptest::ProcessResult cut = klpkccmd(dir, longName, {"STATUS", "SHOW", "DETAILS"});
  klptest::ProcessResult st = status->wait(60000), det = details->wait(60000);
  EXPECT_GE(std::chrono::steady_clock::now() - began, std::chrono::milliseconds(4 * 2001));  // four pauses
  st.out += st.err;
  EXPECT_EQ(st.exitCode, 12) << st.out;
  for (const std::string& want : {std::string("KLP0506E"), std::string("KLP0597E"), e2e::serverQueuePath(dir, "NOBODY")})
    EXPECT_NE(st.out.find(want), std::string::npos) << want << "\n" << st.out;
  for (auto [r, server, code] : {std::tuple{&det, std::string("NOBODY"), "\"2013\""}, {&cut, longName, "\"2009\""}}) {
    EXPECT_EQ(r->exitCode, 12) << r->out;
    EXPECT_EQ(e2e::countOf(r->out, " = "), 3u) << r->out;
    EXPECT_NE(r->out.find("(SERVER) = " + server + "\n"), std::string::npos) << r->out;
    EXPECT_NE(r->out.find("(STATUS) = Unknown: the detailed status could not be obtained\n"), std::string::npos)
        << r->out;
    EXPECT_NE(r->out.find(code), std::string::npos) << r->out;
  }
  EXPECT_FALSE(klptest::queueExists(e2e::serverQueuePath(dir, "NOBODY")));
}

// A server killed before it answers leaves its queue, which takes the
// requests; nobody answers them (30 s, waited for once here, by both runs
// at once): STATUS ends with 12, the detailed status says the server did
// not answer. A server started again replaces the stale queue.
TEST(Klpkccmd, AServerKilledBeforeItAnswersEndsInNoReplyAndAnotherReplacesIt) {
  klptest::TmpDir dir;
  {
    Server first(dir, "GONE");
    ASSERT_TRUE(first.ready());
    first.proc().kill(SIGKILL);
    first.proc().wait(10000);
  }
  ASSERT_TRUE(klptest::queueExists(e2e::serverQueuePath(dir, "GONE")));
  auto status = start("GONE", {"STATUS"});
  klptest::ProcessResult det = klpkccmd(dir, "GONE", {"STATUS", "SHOW", "DETAILS"});
  klptest::ProcessResult st = status->wait(60000);
  EXPECT_EQ(st.exitCode, 12) << st.out;
  EXPECT_NE(st.out.find("KLP0510E"), std::string::npos) << st.out;
  EXPECT_EQ(det.exitCode, 12) << det.out;
  EXPECT_NE(det.out.find("\"1000\""), std::string::npos) << det.out;
  EXPECT_EQ(det.out.find("(STATUS) = Unknown"), std::string::npos) << det.out;
  EXPECT_EQ(e2e::countOf(det.out, " = "), 3u) << det.out;

  Server second(dir, "GONE", {"LOGSTDOUT"});
  // Its own console lines: the first one's log may lack its last lines.
  ASSERT_TRUE(e2e::waitFor([&] { return second.proc().out().find("KLP0594I") != std::string::npos; }, 20000))
      << second.log();
  std::string out = second.proc().out();
  size_t a = out.find("KLP0592I"), d = out.find("KLP0595I"), c = out.find("KLP0594I");
  ASSERT_NE(a, std::string::npos) << out;
  EXPECT_LT(a, d);
  EXPECT_LT(d, c);
  EXPECT_EQ(klpkccmd(dir, "GONE", {"STATUS"}).exitCode, 0);
  stopServer(dir, second, "GONE");
}

// A signal while it waits for the reply: INT and TERM return to the
// recovery point, which reports the signal and ends the run with 12; the
// others end it by their default action once the reply queue is destroyed.
TEST(Klpkccmd, ASignalWhileItWaitsDestroysItsReplyQueue) {
  const struct rlimit noCore = {0, 0};
  setrlimit(RLIMIT_CORE, &noCore);  // SIGQUIT's default action dumps core
  const struct {
    int sig;
    const char* report;  // the signal as the recovery point reports it
  } cases[] = {{SIGINT, "(\"Handled\"): \"SIGINT\""}, {SIGTERM, "(\"Handled\"): \"SIGTERM\""},
               {SIGHUP, "(\"Non-handled\"): \"1\""}, {SIGQUIT, "(\"Non-handled\"): \"3\""},
               {SIGPIPE, "(\"Non-handled\"): \"13\""}};
  for (const auto& c : cases) {
    klptest::TmpDir dir;
    HSVHIPCQueue server;  // a queue that takes the request and nobody answers
    ASSERT_TRUE(e2e::openQueue(server, e2e::serverQueuePath(dir, "SIG"), true));
    auto client = start("SIG", {"STATUS"});
    std::string reply = e2e::replyQueuePath(dir, "SIG", client->pid());
    // Signalled once its request is on the server's queue: while it waits.
    EXPECT_TRUE(e2e::waitFor([&] { return server.hasMessage(); }, 20000));
    EXPECT_TRUE(klptest::queueExists(reply));
    client->kill(c.sig);
    klptest::ProcessResult r = client->wait(30000);
    bool recovered = c.sig == SIGINT || c.sig == SIGTERM;
    EXPECT_EQ((e2e::Ints{r.exitCode, r.signal}), (e2e::Ints{recovered ? 12 : -1, recovered ? 0 : c.sig})) << c.report;
    EXPECT_NE(r.out.find(c.report), std::string::npos) << r.out;
    EXPECT_EQ(r.out.find("\"setRecoveryPoint\"") != std::string::npos, recovered) << r.out;
    EXPECT_FALSE(klptest::queueExists(reply)) << c.report;
    server.destroy();
  }
}
