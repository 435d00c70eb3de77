// The real klpkccmd executable: how each kind of bad command line is
// refused (message number on the console, exit code 12), the usage text,
// and the recognition of STATUS SHOW DETAILS.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/resource.h>

#include <cstdlib>
#include <string>
#include <vector>

#include "common/platform/hsv.h"
#include "tests/testing/klptest.h"

namespace {

// The usage text, byte for byte, as operators know it.
const char kUsage[] =
    "klpkccmd [<parameter>=<value> ...] [command]\n"
    "parameter:\n"
    "  CAPTURE_SCHEMA= : Name of schema used to identify a K Capture program.\n"
    "  CAPTURE_SERVER= : Name of the K Capture control server.\n"
    "  LOGSTDOUT=Y|N   : Send messages to standard output.\n"
    "\n"
    "command:\n"
    "  CHGPARMS        : Change K Capture's operational parameters.\n"
    "  PRUNE           : Prune K Capture's control tables.\n"
    "  QRYPARMS        : Query K Captures's operational parameters.\n"
    "  REINIT          : Reinitialize all of K Capture's subscriptions.\n"
    "  REINITQ=        : Reinitialize one of K Capture's send queues.\n"
    "  STARTQ=         : Start one or all of K Capture's send queues.\n"
    "  STATUS          : Query the status of K Capture's threads.\n"
    "  STOP            : Stop the K Capture program.\n"
    "  STOPQ=          : Stop one or all of K Capture's send queues.\n"
    "  TRCSTART        : Start writing program flow information to the K Capture trace buffer.\n"
    "\n";

class KlpkccmdTest : public ::testing::Test {
 protected:
  void SetUp() override {
    const char* sid = getenv("ORACLE_SID");
    hadSid_ = sid != nullptr;
    if (hadSid_) oldSid_ = sid;
    unsetenv("ORACLE_SID");
  }
  void TearDown() override {
    if (hadSid_) setenv("ORACLE_SID", oldSid_.c_str(), 1);
  }
  klptest::ProcessResult run(const std::vector<std::string>& args,
                             const std::vector<std::string>& env = {}) {
    std::vector<std::string> argv = {klptest::binPath("klpkccmd")};
    argv.insert(argv.end(), args.begin(), args.end());
    return klptest::run(argv, env, 60000);
  }
  // A refused command line: the message on the console, exit code 12, and
  // no server queue left behind (nothing was sent).
  void expectRefused(const std::vector<std::string>& args, const char* msgId,
                     const std::vector<std::string>& env = {}) {
    klptest::ProcessResult r = run(args, env);
    std::string shown;
    for (const auto& a : args) shown += a.substr(0, 40) + " ";
    EXPECT_EQ(r.exitCode, 12) << shown << "\n" << r.out;
    EXPECT_NE(r.out.find(msgId), std::string::npos) << shown << "\n" << r.out;
    EXPECT_NE(r.out.find("KLP0589E"), std::string::npos) << shown << "\n" << r.out;
    last_ = r;
  }

  klptest::TmpDir dir_;
  klptest::ProcessResult last_;
  bool hadSid_ = false;
  std::string oldSid_;
};

TEST_F(KlpkccmdTest, QuestionMarkPrintsTheUsageText) {
  klptest::ProcessResult r = run({"?"});
  EXPECT_EQ(r.exitCode, 12);
  // The program-level message comes first, then the usage text whole.
  size_t nl = r.out.find('\n');
  ASSERT_NE(nl, std::string::npos);
  EXPECT_NE(r.out.substr(0, nl).find("KLP0600I"), std::string::npos) << r.out;
  ASSERT_GE(r.out.size(), nl + sizeof kUsage);
  EXPECT_EQ(r.out.substr(nl + 1, sizeof kUsage - 1), kUsage);
  // Then the step-failed reports, with the help code.
  std::string rest = r.out.substr(nl + sizeof kUsage);
  EXPECT_NE(rest.find("KLP0589E"), std::string::npos) << rest;
  EXPECT_NE(rest.find("\"klpkccmd\""), std::string::npos) << rest;
  EXPECT_NE(rest.find("\"416\""), std::string::npos) << rest;
}

TEST_F(KlpkccmdTest, NoArguments) {
  expectRefused({}, "KLP0524E");
  EXPECT_NE(last_.out.find("CAPTURE_SERVER"), std::string::npos);
  expectRefused({}, "KLP0526E", {"ORACLE_SID=DB1"});
  EXPECT_EQ(last_.out.find("KLP0524E"), std::string::npos);
}

TEST_F(KlpkccmdTest, CommandWords) {
  expectRefused({"X", "STOP", "STATUS"}, "KLP0518E");
  // The leading word names a parameter and the server is named by keyword:
  // the word is left to the parser as a command.
  expectRefused({"STOP", "CAPTURE_SERVER=X", "STATUS"}, "KLP0518E");
  expectRefused({"X", "LOGSTDOUT"}, "KLP0526E");
}

TEST_F(KlpkccmdTest, ChgparmsValues) {
  expectRefused({"X", "CHGPARMS", "COMMIT_INTERVAL=50"}, "KLP0519E");
  expectRefused({"X", "CHGPARMS", "COMMIT_INTERVAL=1000", "COMMIT_INTERVAL=600001"}, "KLP0519E");
  EXPECT_NE(last_.out.find("\"600001\""), std::string::npos) << last_.out;
  expectRefused({"X", "CHGPARMS", "CAPTURE_SCHEMA=KLP1"}, "KLP0527E");
  expectRefused({"X", "CHGPARMS"}, "KLP0527E");
  // Seven characters select QFULL_NUM_RETRIES (0..1000).
  expectRefused({"X", "CHGPARMS", "qfull_n=5000"}, "KLP0519E");
  EXPECT_NE(last_.out.find("\"QFULL_N\""), std::string::npos) << last_.out;
  expectRefused({"X", "CHGPARMS", "TERM=maybe"}, "KLP0519E");
}

TEST_F(KlpkccmdTest, ChgparmsAcceptedIsNotRefused) {
  klptest::ProcessResult r =
      run({"CAPTURE_SERVER=X", "CHGPARMS", "qfull_numbers=5", "COMMIT_INTERVAL=1000",
           "COMMIT_INTERVAL=2000"});
  // Whatever the dispatch makes of it, the command line itself was taken.
  for (const char* id : {"KLP0500E", "KLP0501E", "KLP0502E", "KLP0503E", "KLP0504E", "KLP0518E",
                         "KLP0519E", "KLP0524E", "KLP0526E", "KLP0527E"})
    EXPECT_EQ(r.out.find(id), std::string::npos) << id << "\n" << r.out;
  EXPECT_TRUE(r.exitCode == 0 || r.exitCode == 12) << r.exitCode;
  EXPECT_FALSE(klptest::queueExists(dir_.path() + "X.KLP.KCAP.IPC"));
  EXPECT_FALSE(klptest::memoryExists(dir_.path() + "X.KLP.KCAP.TRC"));
}

TEST_F(KlpkccmdTest, SchemaRule) {
  expectRefused({"X", "CAPTURE_SCHEMA=my-schema", "STOP"}, "KLP0500E");
  expectRefused({"X", "CAPTURE_SCHEMA=\"My-Schema\"", "STOP"}, "KLP0500E");
  expectRefused({"X", "CAPTURE_SCHEMA=", "STOP"}, "KLP0500E");
  std::string longSchema(129, 's');
  expectRefused({"X", "CAPTURE_SCHEMA=" + longSchema, "STOP"}, "KLP0502E");
  // Quoted, the limit counts the name only.
  expectRefused({"X", "CAPTURE_SCHEMA=\"" + std::string(128, 's') + "\"", "STOP", "STOP"},
                "KLP0518E");
}

TEST_F(KlpkccmdTest, ValueLengthLimit) {
  expectRefused({"CAPTURE_SERVER=" + std::string(1039, 'a'), "STOP", "STATUS"}, "KLP0518E");
  EXPECT_EQ(last_.out.find("KLP0502E"), std::string::npos);
  expectRefused({"CAPTURE_SERVER=" + std::string(1040, 'a'), "STOP"}, "KLP0502E");
  // A leading server word too long for its parameter.
  expectRefused({std::string(1041, 'w'), "STOP"}, "KLP0502E");
}

TEST_F(KlpkccmdTest, UnknownKeywords) {
  expectRefused({"X", "FOO=1", "STOP"}, "KLP0504E");
  expectRefused({"X", "KLPPLACEHOLDER=1", "STOP"}, "KLP0504E");
  expectRefused({"X", "klpplaceholder", "STOP"}, "KLP0504E");
  expectRefused({"X", "STOP", "?"}, "KLP0504E");
  expectRefused({"X", std::string(33, 'K') + "=1", "STOP"}, "KLP0504E");
  expectRefused({"X", "CAPTURE_SERVER", "STOP"}, "KLP0504E");  // a string needs "="
  expectRefused({"X", "", "STOP"}, "KLP0504E");
  expectRefused({"X", "\xff\xfe=\x80", "STOP"}, "KLP0504E");
}

TEST_F(KlpkccmdTest, StatusShowDetailsIsShortenedForTheParser) {
  // Only two of the three words: SHOW is an unknown parameter.
  expectRefused({"X", "STATUS", "SHOW"}, "KLP0504E");
  EXPECT_NE(last_.out.find("\"SHOW\""), std::string::npos) << last_.out;
  // All three (any case): the parser sees X, STATUS, EXTRA.
  expectRefused({"X", "status", "show", "details", "EXTRA"}, "KLP0504E");
  EXPECT_NE(last_.out.find("\"EXTRA\""), std::string::npos) << last_.out;
  EXPECT_EQ(last_.out.find("\"show\""), std::string::npos) << last_.out;
  // One argument holding the three words is not recognised.
  expectRefused({"X", "STATUS SHOW DETAILS"}, "KLP0504E");
}

TEST_F(KlpkccmdTest, EndedByASignalWhileWaitingItLeavesNoReplyQueue) {
  // A server queue that takes the request and never answers.
  std::string server = dir_.path() + "SIG.KLP.KCAP.IPC";
  HSVResID id;
  ASSERT_EQ(ECF_OK, hsvIPCGetQueResID(server.c_str(), HSV_QUEUE_RESID_OPTION, &id));
  HSVHIPCQueue queue;
  ASSERT_EQ(ECF_OK, queue.create(id, HSV_MAX_MSG_SIZE, HSV_CREATE_OPTION));
  struct rlimit none = {0, 0};  // SIGQUIT would leave a core file
  setrlimit(RLIMIT_CORE, &none);
  for (int sig : {SIGHUP, SIGQUIT, SIGPIPE, SIGUSR2}) {
    SCOPED_TRACE(sig);
    klptest::Background client({klptest::binPath("klpkccmd"), "CAPTURE_SERVER=SIG", "STATUS"});
    std::string reply = server + ".CMD" + std::to_string(client.pid());
    char msg[HSV_MAX_MSG_SIZE];
    size_t got = 0;
    // Its request has arrived: it waits for the reply.
    EXPECT_EQ(ECF_OK, queue.get(msg, sizeof msg, &got, 30000));
    EXPECT_TRUE(klptest::queueExists(reply));
    client.kill(sig);
    klptest::ProcessResult r = client.wait(30000);
    EXPECT_EQ(sig, r.signal) << r.out;
    EXPECT_FALSE(klptest::queueExists(reply)) << r.out;
  }
  queue.destroy();
}

}  // namespace
