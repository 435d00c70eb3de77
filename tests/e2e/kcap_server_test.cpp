// The sample server and its command engine, driven over the real queues by a
// raw client and by the exported control interface.
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstring>
#include <string>
#include <vector>

#include "common/env/klpenv.h"
#include "common/ipc/cmdapi.h"
#include "common/platform/hsv.h"
#include "common/thread/klpthread.h"
#include "include/klpapi.h"
#include "tests/e2e/e2e_support.h"

using e2e::RawClient;
using e2e::Reply;
using e2e::Server;

namespace {

constexpr int kStop = 14, kStatus = 15, kResume = 18, kSuspend = 19, kChgparms = 20, kReinitq = 23,
              kSizeQuery = 59;

// Stops the server over the channel and checks that it ended cleanly and
// left its queue nowhere.
void stopCleanly(Server& s, RawClient& c) {
  Reply r;
  ASSERT_TRUE(c.ask(kStop, &r));
  EXPECT_EQ((e2e::Ints{r.header.func, r.header.msgLength}), (e2e::Ints{kStop, 44}));
  EXPECT_EQ(s.proc().wait(30000).exitCode, 0) << s.log();
  EXPECT_FALSE(klptest::queueExists(s.queue()));
}

// The workers' states by a STATUS, once they match `want` (10 s at most).
bool statesBecome(RawClient& c, const std::map<std::string, int32_t>& want) {
  return e2e::waitFor([&] {
    Reply st;
    return c.ask(kStatus, &st) && e2e::threadStates(st) == want;
  }, 10000);
}

}  // namespace

TEST(KcapServer, StatusSuspendResumeAndStop) {
  klptest::TmpDir dir;
  Server s(dir, "ST1");
  ASSERT_TRUE(s.ready()) << s.proc().err();
  RawClient c(s.queue());
  ASSERT_TRUE(c.ok());
  const int32_t rest = KLP_THREAD_REST, wait = KLP_THREAD_WAIT;
  // The queue exists before the workers have settled: wait until they rest.
  ASSERT_TRUE(statesBecome(c, {{"AdminThread", rest}, {"WorkerThread", rest}, {"PruneThread", rest},
                               {"HoldLThread", rest}}));
  Reply r;
  ASSERT_TRUE(c.ask(kStatus, &r));
  // 12 header bytes, one record per thread, and one record's room more.
  EXPECT_EQ((e2e::Ints{r.header.msgLength, r.header.senderPid}), (e2e::Ints{44 + 12 + 20 * 5, s.proc().pid()}));
  ASSERT_TRUE(c.ask(kSizeQuery, &r));
  EXPECT_EQ(r.header.msgLength, 60);
  EXPECT_EQ(std::string(r.payload.data(), 16), std::string("klpSISize: \0\4\0\0\0", 16));

  // Each worker takes SUSPEND from its own command list in its own time;
  // the admin thread carries on.
  ASSERT_TRUE(c.ask(kSuspend, &r));
  EXPECT_EQ(r.header.func, kSuspend);
  ASSERT_TRUE(statesBecome(c, {{"AdminThread", rest}, {"WorkerThread", wait}, {"PruneThread", wait},
                               {"HoldLThread", wait}}));
  ASSERT_TRUE(c.ask(kResume, &r));
  ASSERT_TRUE(statesBecome(c, {{"AdminThread", rest}, {"WorkerThread", rest}, {"PruneThread", rest},
                               {"HoldLThread", rest}}));
  stopCleanly(s, c);
  EXPECT_NE(s.log().find("<cmdsEngine> KLP0522I"), std::string::npos) << s.log();
}

TEST(KcapServer, SignalsEndItCleanly) {
  for (int sig : {SIGINT, SIGTERM}) {
    klptest::TmpDir dir;
    Server s(dir, "SIG");
    ASSERT_TRUE(s.ready());
    s.proc().kill(sig);
    EXPECT_EQ(s.proc().wait(30000).exitCode, 0) << "signal " << sig << "\n" << s.log();
    EXPECT_FALSE(klptest::queueExists(s.queue())) << "signal " << sig;
    EXPECT_NE(s.log().find("A global signal was received"), std::string::npos);
  }
}

TEST(KcapServer, AQueryLongerThanOneMessageReachesTheCommandProgramInPieces) {
  klptest::TmpDir dir;
  const std::string v(1000, 'v');
  // A working directory of its own with a long name, and two long values.
  std::string path = dir.path() + std::string(200, 'p');
  for (int i = 0; i < 4; ++i, path += "/" + std::string(200, 'p')) ASSERT_EQ(mkdir(path.c_str(), 0700), 0);
  ASSERT_EQ(mkdir(path.c_str(), 0700), 0);
  Server s(dir, "LNG", {"CAPTURE_PATH=" + path, "CAP_DBNAME=D" + v, "COMPATIBILITY=C" + v});
  ASSERT_TRUE(s.ready());
  klptest::ProcessResult pr = klptest::run({klptest::binPath("klpkccmd"), "CAPTURE_SERVER=LNG", "QRYPARMS"}, {}, 60000);
  EXPECT_EQ(pr.exitCode, 0) << pr.out;
  for (const std::string& want : std::vector<std::string>{"\"COMPATIBILITY\" has the value \"C" + v.substr(900), "\"CAP_DBNAME\" has the value \"D" + v.substr(900),
                           "\"CAPTURE_SERVER\" has the value \"LNG\""})
    EXPECT_NE(pr.out.find(want), std::string::npos) << want << "\n" << pr.out;
  RawClient c(s.queue());
  stopCleanly(s, c);
}

// Garbage on the queue neither crashes nor hangs it: shorter than a header,
// lengths that lie and a foreign eye-catcher get no answer; a queue name of
// the largest size without NUL reaches the thread that takes it, cut; a
// CHGPARMS value without NUL, longer than any parameter, is echoed whole.
TEST(KcapServer, GarbageOnTheQueueNeitherCrashesNorHangsIt) {
  klptest::TmpDir dir;
  Server s(dir, "GAR");
  ASSERT_TRUE(s.ready());
  RawClient c(s.queue());
  auto sized = [](std::vector<char> m, size_t size, char fill, int32_t claim) {
    m.resize(size, fill);
    memcpy(m.data() + 12, &claim, 4);
    return m;
  };
  auto eye = RawClient::request(kStatus);
  memcpy(eye.data(), "XYZ:", 4);
  for (const auto& m : {std::vector<char>(10, 'I'), sized(RawClient::request(kStatus), 44, 0, 4000),
                        sized(RawClient::request(kStatus), 44, 0, 20), eye, sized(RawClient::request(kReinitq), 4096, 'Q', 4096),
                        sized(RawClient::request(kChgparms, 43), 3000, 'W', 3000)})
    ASSERT_TRUE(c.sendBytes(m));
  Reply r;
  for (auto [func, length] : {std::pair{kReinitq, 44}, {kChgparms, 3000}, {kStatus, 44 + 12 + 20 * 5}}) {
    ASSERT_TRUE(func != kStatus ? c.receive(&r) : c.ask(kStatus, &r));
    EXPECT_EQ((e2e::Ints{r.header.func, r.header.msgLength}), (e2e::Ints{func, length}));
  }
  EXPECT_TRUE(e2e::waitFor([&] { return s.log().find("reinitialized the send queue \"QQQQ") != std::string::npos; },
                           10000));
  stopCleanly(s, c);
}

TEST(KcapServer, ANamePrefixThatDoesNotFitIsReportedWithTheBuildersCode) {
  // 170 + ".KLP.KCAP" is more than the prefix's 160 characters.
  klptest::TmpDir dir;
  const std::string server = "CAPTURE_SERVER=" + std::string(170, 'N');
  for (const auto& argv : {std::vector<std::string>{klptest::binPath("klpkcap"), server},
                           {klptest::binPath("klpkccmd"), server, "STATUS"}}) {
    klptest::ProcessResult pr = klptest::run(argv, {}, 30000);
    EXPECT_EQ(pr.exitCode, 12) << argv[0];
    EXPECT_NE(pr.out.find("a step failed with return code \"6005\": \"setEnvNamePrefix\""), std::string::npos)
        << argv[0] << "\n" << pr.out;
  }
}

// The exported control interface, in this process, against the sample
// server: its detailed status in format 3, a buffer too small, its stop.
TEST(KcapServer, ControlInterfaceStatusAndStop) {
  klptest::TmpDir dir;
  klpEnvClear(klpGetEnv());  // the IPC directory is this test's
  klpEnsureMainThread();
  Server s(dir, "API");
  ASSERT_TRUE(s.ready());
  klpReleaseInfo rel{KLP_KIND_KCAP, 9, 1, 0};
  klpResultBlock res;
  klpStatusRequest q;
  memset(&q, 0, sizeof q);
  strcpy(q.serverName, "api");  // names are upper-cased
  strcpy(q.schema, "klp");
  klpStatusFmt3 data;
  memset(&data, 0x5A, sizeof data);
  q.buffer = &data;
  q.bufferSize = sizeof data;
  ASSERT_EQ(klpGetStatus(&rel, &q, &res), 0) << res.text;
  EXPECT_EQ((e2e::Ints{q.requiredSize, data.format, data.activeSubs}), (e2e::Ints{2224, 3, 0}));
  EXPECT_GE(data.upTime, 0);
  EXPECT_EQ(std::string(data.logFile), e2e::logPath(dir, "API"));
  EXPECT_EQ(strlen(data.currentLogTime), 26u);
  EXPECT_GT(data.currentMemory, 0);
  char small[100];
  memset(small, 0x5A, sizeof small);
  q.buffer = small;
  q.bufferSize = sizeof small;
  EXPECT_EQ(klpGetStatus(&rel, &q, &res), 1001);
  EXPECT_EQ(small[0], 0x5A);  // nothing filled
  EXPECT_EQ(klpStopProgram(KLP_KIND_KCAP, "API", "KLP", 0, &res), 0) << res.text;
  EXPECT_EQ(s.proc().wait(30000).exitCode, 0);
  EXPECT_FALSE(klptest::queueExists(s.queue()));
  EXPECT_FALSE(klptest::queueExists(s.queue() + ".CMD" + std::to_string(getpid())));
  klpEnvClear(klpGetEnv());
}
