// The sample server over the real queues: a raw client, the command program, the control interface.
#include <sys/stat.h>

#include "common/env/klpenv.h"
#include "common/ipc/cmdapi.h"
#include "common/thread/klpthread.h"
#include "include/klpapi.h"
#include "tests/e2e/e2e_support.h"

using e2e::Ints;
using e2e::RawClient;
using e2e::Reply;
using e2e::Server;

namespace {

constexpr int kStatus = 15, kResume = 18, kSuspend = 19, kChgparms = 20, kReinitq = 23;

// A signal ends the server with 0, its queue taken, and says so in its log (when given).
void endsBy(int sig, Server& s, const std::string& logFile = "") {
  s.proc().kill(sig);
  EXPECT_EQ(s.proc().wait(30000).exitCode, 0) << sig;
  EXPECT_FALSE(klptest::queueExists(s.queue())) << sig;
  EXPECT_TRUE(logFile.empty() || klptest::readFile(logFile).find("A global signal was received") != std::string::npos);
}

// True once a STATUS shows the admin thread resting and the workers in `workers` state.
bool statesBecome(RawClient& c, int32_t workers) {
  return e2e::waitFor([&] {
    Reply st;
    std::map<std::string, int32_t> got;
    if (!c.ask(kStatus, &st)) return false;
    for (int32_t i = 0; i < e2e::rd32(st.payload, 8) && size_t(32 + 20 * i) <= st.payload.size(); ++i)
      got[std::string(st.payload.data() + 12 + 20 * i, strnlen(st.payload.data() + 12 + 20 * i, 16))] =
          e2e::rd32(st.payload, 28 + 20 * i);
    return got == std::map<std::string, int32_t>{{"AdminThread", KLP_THREAD_REST}, {"WorkerThread", workers},
                                                  {"PruneThread", workers}, {"HoldLThread", workers}};
  }, 10000);
}

}  // namespace

// Garbage gets no answer; values without NUL are cut or echoed whole; SUSPEND reaches the workers only.
TEST(KcapServer, GarbageNeitherCrashesNorHangsItAndSuspendResumeReachTheWorkers) {
  klptest::TmpDir dir;
  Server s(dir, "GAR");
  ASSERT_TRUE(s.ready());
  RawClient c(s.queue());
  auto sized = [](int32_t func, int32_t sub, size_t size, char fill, int32_t claim) {
    std::vector<char> m = RawClient::request(func, sub);
    m.resize(size, fill);
    memcpy(m.data() + 12, &claim, 4);
    return m;
  };
  auto eye = RawClient::request(kStatus);
  memcpy(eye.data(), "XYZ:", 4);
  for (const auto& m : {std::vector<char>(10, 'I'), sized(kStatus, 0, 44, 0, 4000), sized(kStatus, 0, 44, 0, 20), eye,
                        sized(kReinitq, 0, 4096, 'Q', 4096), sized(kChgparms, 43, 3000, 'W', 3000)})
    ASSERT_TRUE(c.sendBytes(m));
  Reply r;
  for (auto [func, length] : {std::pair{kReinitq, 44}, {kChgparms, 3000}, {kStatus, 44 + 12 + 20 * 5}}) {
    ASSERT_TRUE(func != kStatus ? c.receive(&r) : c.ask(kStatus, &r));
    EXPECT_EQ((Ints{r.header.func, r.header.msgLength}), (Ints{func, length}));
  }
  EXPECT_EQ(r.header.senderPid, s.pid());
  EXPECT_TRUE(e2e::waitFor([&] { return s.log().find("reinitialized the send queue \"QQQQ") != std::string::npos; },
                           10000));
  ASSERT_TRUE(statesBecome(c, KLP_THREAD_REST));  // the queue comes before the workers settle
  ASSERT_TRUE(c.ask(kSuspend, &r));
  EXPECT_EQ(r.header.func, kSuspend);
  ASSERT_TRUE(statesBecome(c, KLP_THREAD_WAIT));
  ASSERT_TRUE(c.ask(kResume, &r));
  ASSERT_TRUE(statesBecome(c, KLP_THREAD_REST));
  endsBy(SIGTERM, s, e2e::logPath(dir, "GAR"));
}

// A long working directory and two long values: QRYPARMS comes in pieces.
TEST(KcapServer, AQueryLongerThanOneMessageReachesTheCommandProgramInPieces) {
  klptest::TmpDir dir;
  const std::string v(1000, 'v');
  std::string path = dir.path();
  for (int i = 0; i < 5; ++i) ASSERT_EQ(mkdir((path += std::string(200, 'p') + "/").c_str(), 0700), 0);
  Server s(dir, "LNG", {"CAPTURE_PATH=" + path, "CAP_DBNAME=D" + v, "COMPATIBILITY=C" + v});
  ASSERT_TRUE(s.ready());
  klptest::ProcessResult pr = klptest::run({klptest::binPath("klpkccmd"), "CAPTURE_SERVER=LNG", "QRYPARMS"});
  EXPECT_EQ(pr.exitCode, 0) << pr.out;
  for (const std::string& want : {"\"COMPATIBILITY\" has the value \"C" + v.substr(900),
                                  "\"CAP_DBNAME\" has the value \"D" + v.substr(900),
                                  std::string("\"CAPTURE_SERVER\" has the value \"LNG\"")})
    EXPECT_NE(pr.out.find(want), std::string::npos) << want << "\n" << pr.out;
  endsBy(SIGINT, s);
}

// 170 + ".KLP.KCAP" is more than the name prefix's 160 characters.
TEST(KcapServer, ANamePrefixThatDoesNotFitIsReportedWithTheBuildersCode) {
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

// The control interface in this process: the detailed status in format 3, and the stop.
TEST(KcapServer, ControlInterfaceStatusAndStop) {
  klptest::TmpDir dir;
  klpEnvClear(klpGetEnv());  // the IPC directory is this test's
  klpEnsureMainThread();
  Server s(dir, "API");
  ASSERT_TRUE(s.ready());
  klpReleaseInfo rel{KLP_KIND_KCAP, 9, 1, 0};
  klpResultBlock res;
  klpStatusRequest q{};
  strcpy(q.serverName, "api");  // names are upper-cased
  strcpy(q.schema, "klp");
  klpStatusFmt3 data;
  q.buffer = &data;
  q.bufferSize = sizeof data;
  ASSERT_EQ(klpGetStatus(&rel, &q, &res), 0) << res.text;
  EXPECT_EQ((Ints{q.requiredSize, data.format, data.activeSubs}), (Ints{2224, 3, 0}));
  EXPECT_EQ(std::string(data.logFile), e2e::logPath(dir, "API"));
  EXPECT_EQ(strlen(data.currentLogTime), 26u);
  EXPECT_GT(data.currentMemory, 0);
  EXPECT_EQ(klpStopProgram(KLP_KIND_KCAP, "API", "KLP", 0, &res), 0) << res.text;
  EXPECT_EQ(s.proc().wait(30000).exitCode, 0);
  EXPECT_FALSE(klptest::queueExists(s.queue()));
  EXPECT_FALSE(klptest::queueExists(s.queue() + ".CMD" + std::to_string(getpid())));
  klpEnvClear(klpGetEnv());
}
