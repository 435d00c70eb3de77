// The command program against the sample server: real processes, nothing left behind.
#include <sys/resource.h>

#include <chrono>

#include "tests/e2e/e2e_support.h"

using e2e::countOf;
using e2e::Server;

namespace {

std::unique_ptr<klptest::Background> start(const std::string& server, std::vector<std::string> args) {
  args.insert(args.begin(), {klptest::binPath("klpkccmd"), "CAPTURE_SERVER=" + server});
  return std::make_unique<klptest::Background>(args);
}

// Waits for a run to end, its output and error joined; its reply queue must be gone.
klptest::ProcessResult ended(const klptest::TmpDir& dir, const std::string& server, klptest::Background& b) {
  klptest::ProcessResult r = b.wait(90000);
  EXPECT_FALSE(klptest::queueExists(e2e::replyQueuePath(dir, server, b.pid())));
  r.out += r.err;
  return r;
}
klptest::ProcessResult klpkccmd(const klptest::TmpDir& dir, const std::string& server,
                                const std::vector<std::string>& args) {
  return ended(dir, server, *start(server, args));
}

void stopServer(const klptest::TmpDir& dir, Server& s, const std::string& name) {
  EXPECT_EQ(klpkccmd(dir, name, {"STOP"}).exitCode, 0);
  EXPECT_EQ(s.proc().wait(30000).exitCode, 0) << s.log();
  EXPECT_FALSE(klptest::queueExists(s.queue()));
}

bool has(const std::string& text, const std::string& part) { return text.find(part) != std::string::npos; }

}  // namespace

// Every command word, then four clients at once (two queues each, of the user's few), each with its replies.
TEST(Klpkccmd, EveryCommandWordSucceedsAndClientsAtOnceGetTheirOwnReplies) {
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
    if (args[0] == "CHGPARMS") { EXPECT_EQ(countOf(c.out, "KLP0523I"), 2u) << c.out; }
    for (const char* want : {"\"COMMIT_INTERVAL\" has the value \"1000\" from \"CHGPARMS COMMAND\"",
                             "\"SLEEP_INTERVAL\" has the value \"200\" from \"CHGPARMS COMMAND\""})
      EXPECT_EQ(has(c.out, want), args[0] == "QRYPARMS") << want << "\n" << c.out;
    if (args.size() == 3 && args[1] == "SHOW") {  // nine rows, the log file from the server
      EXPECT_EQ(countOf(c.out, " = "), 9u) << c.out;
      EXPECT_TRUE(has(c.out, "(LOGFILE) = " + e2e::logPath(dir, "ALL") + "\n")) << c.out;
    } else if (args[0] == "STATUS") {
      EXPECT_EQ(countOf(c.out, "KLP0520I"), 4u) << c.out;
    }
  }
  EXPECT_TRUE(e2e::waitFor([&] { return has(s.log(), "SENDQ1"); }, 5000)) << s.log();
  // The detailed status was answered by a thread through the reply sender.
  EXPECT_TRUE(has(s.log(), "<KLPResponseFunc> KLP0592I")) << s.log();

  std::vector<std::unique_ptr<klptest::Background>> clients;
  for (int i = 0; i < 4; ++i) clients.push_back(start("ALL", {i % 2 ? "QRYPARMS" : "STATUS"}));
  for (int i = 0; i < 4; ++i) {
    klptest::ProcessResult r = ended(dir, "ALL", *clients[i]);
    EXPECT_EQ(r.exitCode, 0) << r.out;
    EXPECT_EQ(countOf(r.out, "KLP0520I"), i % 2 ? 0u : 4u) << r.out;
    EXPECT_EQ(has(r.out, "COMMIT_INTERVAL"), i % 2 == 1) << r.out;
  }
  stopServer(dir, s, "ALL");
}

// No server: five attaches (8 s, waited for once by all runs), exit 12, a short report without "up".
TEST(Klpkccmd, WithoutAServerStatusEndsWith12) {
  klptest::TmpDir dir;
  const std::string longName(140, 'L');  // cut to the request's 128 it would name another server
  auto began = std::chrono::steady_clock::now();
  auto status = start("NOBODY", {"STATUS"}), details = start("NOBODY", {"STATUS", "SHOW", "DETAILS"});
  klptest::ProcessResult cut = klpkccmd(dir, longName, {"STATUS", "SHOW", "DETAILS"});
  klptest::ProcessResult st = ended(dir, "NOBODY", *status), det = ended(dir, "NOBODY", *details);
  EXPECT_GE(std::chrono::steady_clock::now() - began, std::chrono::milliseconds(4 * 2001));  // four pauses
  EXPECT_EQ(st.exitCode, 12) << st.out;
  for (const std::string& want : {std::string("KLP0506E"), std::string("KLP0597E"), dir.path() + "NOBODY.KLP.KCAP.IPC"})
    EXPECT_TRUE(has(st.out, want)) << want << "\n" << st.out;
  for (auto [r, server, code] : {std::tuple{&det, std::string("NOBODY"), "\"2013\""}, {&cut, longName, "\"2009\""}}) {
    EXPECT_EQ(r->exitCode, 12) << r->out;
    EXPECT_EQ(countOf(r->out, " = "), 3u) << r->out;
    EXPECT_TRUE(has(r->out, "(SERVER) = " + server + "\n")) << r->out;
    EXPECT_TRUE(has(r->out, "(STATUS) = Unknown: the detailed status could not be obtained\n")) << r->out;
    EXPECT_TRUE(has(r->out, code)) << r->out;
  }
  EXPECT_FALSE(klptest::queueExists(e2e::serverQueuePath(dir, "NOBODY")));
}

// A killed server's queue: no answer (30 s, waited for once by both runs), exit 12; a new server replaces it.
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
  klptest::ProcessResult st = ended(dir, "GONE", *status);
  EXPECT_EQ(st.exitCode, 12) << st.out;
  EXPECT_TRUE(has(st.out, "KLP0510E")) << st.out;
  EXPECT_EQ(det.exitCode, 12) << det.out;
  EXPECT_TRUE(has(det.out, "\"1000\"") && !has(det.out, "(STATUS) = Unknown")) << det.out;
  EXPECT_EQ(countOf(det.out, " = "), 3u) << det.out;

  Server second(dir, "GONE", {"LOGSTDOUT"});
  // Its own console lines: the first one's log may lack its last lines.
  ASSERT_TRUE(e2e::waitFor([&] { return has(second.proc().out(), "KLP0594I"); }, 20000)) << second.log();
  std::string out = second.proc().out();
  size_t a = out.find("KLP0592I"), d = out.find("KLP0595I"), c = out.find("KLP0594I");
  EXPECT_TRUE(a < d && d < c) << out;
  EXPECT_EQ(klpkccmd(dir, "GONE", {"STATUS"}).exitCode, 0);
  stopServer(dir, second, "GONE");
}

// A signal while waiting: INT and TERM end with 12 at the recovery point, others by default, reply queue gone.
TEST(Klpkccmd, ASignalWhileItWaitsDestroysItsReplyQueue) {
  const struct rlimit noCore = {0, 0};
  setrlimit(RLIMIT_CORE, &noCore);  // SIGQUIT's default action dumps core
  const struct {
    int sig;
    const char* report;
  } cases[] = {{SIGINT, "(\"Handled\"): \"SIGINT\""}, {SIGTERM, "(\"Handled\"): \"SIGTERM\""},
               {SIGHUP, "(\"Non-handled\"): \"1\""}, {SIGQUIT, "(\"Non-handled\"): \"3\""},
               {SIGPIPE, "(\"Non-handled\"): \"13\""}};
  for (const auto& c : cases) {
    klptest::TmpDir dir;
    HSVHIPCQueue server;  // takes the request, and nobody answers
    ASSERT_TRUE(e2e::openQueue(server, e2e::serverQueuePath(dir, "SIG"), true));
    auto client = start("SIG", {"STATUS"});
    std::string reply = e2e::replyQueuePath(dir, "SIG", client->pid());
    EXPECT_TRUE(e2e::waitFor([&] { return server.hasMessage(); }, 20000));  // it waits now
    EXPECT_TRUE(klptest::queueExists(reply));
    client->kill(c.sig);
    klptest::ProcessResult r = client->wait(30000);
    bool recovered = c.sig == SIGINT || c.sig == SIGTERM;
    EXPECT_EQ((e2e::Ints{r.exitCode, r.signal}), (e2e::Ints{recovered ? 12 : -1, recovered ? 0 : c.sig})) << c.report;
    EXPECT_TRUE(has(r.out, c.report)) << r.out;
    EXPECT_EQ(has(r.out, "\"setRecoveryPoint\""), recovered) << r.out;
    EXPECT_FALSE(klptest::queueExists(reply)) << c.report;
    server.destroy();
  }
}
