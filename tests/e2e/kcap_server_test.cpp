// The sample server and its command engine, driven over the real queues by a
// raw client and by the exported control interface.
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>
#include <string>
#include <vector>

#include "common/env/klpenv.h"
#include "common/msg/klplog.h"
#include "common/msg/msglogger.h"
#include "common/platform/hsv.h"
#include "common/thread/klpthread.h"
#include "include/klpapi.h"
#include "tests/e2e/e2e_support.h"

using e2e::RawClient;
using e2e::Reply;
using e2e::Server;

namespace {

constexpr int kStop = 14, kStatus = 15, kQryparms = 17, kResume = 18, kSuspend = 19,
              kChgparms = 20, kReinitq = 23, kSizeQuery = 59, kDetails = 60;
constexpr int kCommitInterval = 30, kTerm = 5, kCapturePath = 7;

// Stops the server over the channel and checks that it ended cleanly and
// left its queue nowhere.
void stopCleanly(Server& s, RawClient& c) {
  Reply r;
  ASSERT_TRUE(c.ask(kStop, &r));
  EXPECT_EQ(r.header.func, kStop);
  EXPECT_EQ(r.header.msgLength, 44);
  klptest::ProcessResult pr = s.proc().wait(30000);
  EXPECT_EQ(pr.exitCode, 0) << s.log();
  EXPECT_FALSE(klptest::queueExists(s.queue()));
}

}  // namespace

TEST(KcapServer, StatusListsItsThreadsAndStopEndsCleanly) {
  klptest::TmpDir dir;
  Server s(dir, "ST1");
  ASSERT_TRUE(s.ready()) << s.proc().err();
  {
    RawClient c(s.queue());
    ASSERT_TRUE(c.ok());
    Reply r;
    // The queue exists before the workers have settled: wait until they rest.
    ASSERT_TRUE(e2e::waitFor(
        [&] {
          if (!c.ask(kStatus, &r)) return false;
          auto st = e2e::threadStates(r);
          for (auto& [name, state] : st)
            if (state != KLP_THREAD_REST) return false;
          return st.size() == 4;
        },
        10000));
    // 12 header bytes, one record per thread, and one record's room more.
    EXPECT_EQ(r.header.msgLength, 44 + 12 + 20 * 5);
    EXPECT_EQ(r.header.senderPid, s.pid());
    auto states = e2e::threadStates(r);
    ASSERT_EQ(states.size(), 4u);
    for (const char* n : {"AdminThread", "WorkerThread", "PruneThread", "HoldLThread"}) {
      ASSERT_TRUE(states.count(n)) << n;
      EXPECT_EQ(states[n], KLP_THREAD_REST) << n;
    }

    ASSERT_TRUE(c.ask(kSizeQuery, &r));
    EXPECT_EQ(r.header.msgLength, 60);
    EXPECT_STREQ(r.payload.data(), "klpSISize: ");
    EXPECT_EQ(e2e::rd32(r.payload, 12), 4);
    stopCleanly(s, c);
  }
  EXPECT_FALSE(klptest::queueExists(dir.path() + "ST1.KLP.KCAP.IPC.CMD" + std::to_string(getpid())));
  EXPECT_NE(s.log().find("KLP0522I"), std::string::npos);
}

TEST(KcapServer, SignalsEndItCleanly) {
  for (int sig : {SIGINT, SIGTERM}) {
    klptest::TmpDir dir;
    Server s(dir, "SIG");
    ASSERT_TRUE(s.ready());
    s.proc().kill(sig);
    klptest::ProcessResult pr = s.proc().wait(30000);
    EXPECT_EQ(pr.exitCode, 0) << "signal " << sig << "\n" << s.log();
    EXPECT_FALSE(klptest::queueExists(s.queue())) << "signal " << sig;
    EXPECT_NE(s.log().find("A global signal was received"), std::string::npos);
  }
}

TEST(KcapServer, SuspendAndResumeChangeTheWorkersButNotTheAdminThread) {
  klptest::TmpDir dir;
  Server s(dir, "SUS");
  ASSERT_TRUE(s.ready());
  RawClient c(s.queue());
  ASSERT_TRUE(c.ok());
  Reply r;
  ASSERT_TRUE(c.ask(kSuspend, &r));
  EXPECT_EQ(r.header.func, kSuspend);
  ASSERT_TRUE(e2e::waitFor(
      [&] {
        Reply st;
        if (!c.ask(kStatus, &st)) return false;
        auto m = e2e::threadStates(st);
        // Each worker takes the request from its own command list in its own
        // time: wait until all of them have.
        return m["WorkerThread"] == KLP_THREAD_WAIT && m["PruneThread"] == KLP_THREAD_WAIT &&
               m["HoldLThread"] == KLP_THREAD_WAIT && m["AdminThread"] == KLP_THREAD_REST;
      },
      10000));
  ASSERT_TRUE(c.ask(kStatus, &r));
  auto states = e2e::threadStates(r);
  EXPECT_EQ(states["AdminThread"], KLP_THREAD_REST);
  EXPECT_EQ(states["PruneThread"], KLP_THREAD_WAIT);

  // Suspended threads still keep the server up across supervision passes.
  std::this_thread::sleep_for(std::chrono::milliseconds(1500));
  ASSERT_TRUE(s.proc().running());

  ASSERT_TRUE(c.ask(kResume, &r));
  ASSERT_TRUE(e2e::waitFor(
      [&] {
        Reply st;
        if (!c.ask(kStatus, &st)) return false;
        auto m = e2e::threadStates(st);
        return m["WorkerThread"] == KLP_THREAD_REST && m["PruneThread"] == KLP_THREAD_REST &&
               m["HoldLThread"] == KLP_THREAD_REST;
      },
      10000));
  stopCleanly(s, c);
}

TEST(KcapServer, ChgparmsIsEchoedAndQryparmsShowsTheChangeWithItsSource) {
  klptest::TmpDir dir;
  Server s(dir, "CHG");
  ASSERT_TRUE(s.ready());
  RawClient c(s.queue());
  ASSERT_TRUE(c.ok());

  Reply r;
  ASSERT_TRUE(c.ask(kQryparms, &r));
  auto before = e2e::queryRecords(r.payload);
  ASSERT_TRUE(before.count("COMMIT_INTERVAL"));
  EXPECT_EQ(before["COMMIT_INTERVAL"].value, "500");
  EXPECT_EQ(before["COMMIT_INTERVAL"].source, 0);
  EXPECT_EQ(before["CAPTURE_SERVER"].value, "CHG");

  std::string v = "1000";
  auto request = RawClient::request(kChgparms, kCommitInterval, &v);
  ASSERT_TRUE(c.ask(kChgparms, &r, kCommitInterval, &v));
  // The request comes back whole; only the sender differs.
  ASSERT_EQ(r.raw.size(), request.size());
  EXPECT_EQ(r.header.senderPid, s.pid());
  EXPECT_EQ(r.header.subFunc, kCommitInterval);
  EXPECT_EQ(memcmp(r.raw.data() + 44, request.data() + 44, request.size() - 44), 0);

  // A flag given neither Y nor N, and a parameter that may not change while
  // the server runs, are echoed but change nothing.
  std::string maybe = "MAYBE", path = "/elsewhere/";
  ASSERT_TRUE(c.ask(kChgparms, &r, kTerm, &maybe));
  EXPECT_EQ(r.header.subFunc, kTerm);
  ASSERT_TRUE(c.ask(kChgparms, &r, kCapturePath, &path));
  // An integer that is not a whole number, or is out of its range, changes
  // nothing either; nor does an index outside the set.
  std::string bad = "12abc", low = "50", term = "yes";
  ASSERT_TRUE(c.ask(kChgparms, &r, 16, &bad));
  ASSERT_TRUE(c.ask(kChgparms, &r, kCommitInterval, &low));
  ASSERT_TRUE(c.ask(kChgparms, &r, 4000, &low));
  EXPECT_EQ(r.header.subFunc, 4000);
  ASSERT_TRUE(c.ask(kChgparms, &r, kTerm, &term));

  ASSERT_TRUE(c.ask(kQryparms, &r));
  auto after = e2e::queryRecords(r.payload);
  EXPECT_EQ(after["COMMIT_INTERVAL"].value, "1000");
  EXPECT_EQ(after["COMMIT_INTERVAL"].source, 3);
  EXPECT_EQ(after["SLEEP_INTERVAL"].value, "5000");
  EXPECT_EQ(after["SLEEP_INTERVAL"].source, 0);
  EXPECT_EQ(after["TERM"].value, "Y");
  EXPECT_EQ(after["TERM"].source, 3);
  EXPECT_EQ(after["CAPTURE_PATH"].value, dir.path());
  EXPECT_NE(after["CAPTURE_PATH"].source, 3);
  stopCleanly(s, c);
}

TEST(KcapServer, AQueryLongerThanOneMessageReachesTheCommandProgramInPieces) {
  klptest::TmpDir dir;
  const std::string v(1000, 'v');
  // A working directory of its own with a long name, and two long values.
  std::string path = dir.path() + std::string(200, 'p');
  for (int i = 0; i < 4; ++i) {
    ASSERT_EQ(mkdir(path.c_str(), 0700), 0);
    path += "/" + std::string(200, 'p');
  }
  ASSERT_EQ(mkdir(path.c_str(), 0700), 0);
  Server s(dir, "LNG", {"CAPTURE_PATH=" + path, "CAP_DBNAME=D" + v, "COMPATIBILITY=C" + v});
  ASSERT_TRUE(s.ready());
  klptest::ProcessResult pr =
      klptest::run({klptest::binPath("klpkccmd"), "CAPTURE_SERVER=LNG", "QRYPARMS"}, {}, 60000);
  EXPECT_EQ(pr.exitCode, 0) << pr.out;
  for (const char* name : {"\"COMPATIBILITY\" has the value \"Cvvv",
                           "\"CAP_DBNAME\" has the value \"Dvvv",
                           "\"CAPTURE_SERVER\" has the value \"LNG\""})
    EXPECT_NE(pr.out.find(name), std::string::npos) << name << "\n" << pr.out;
  RawClient c(s.queue());
  stopCleanly(s, c);
}

TEST(KcapServer, DetailedStatusPayloadHasTheCollectorsPlacement) {
  klptest::TmpDir dir;
  Server s(dir, "DET");
  ASSERT_TRUE(s.ready());
  RawClient c(s.queue());
  ASSERT_TRUE(c.ok());
  Reply r;
  ASSERT_TRUE(c.ask(kDetails, &r));
  EXPECT_EQ(r.header.func, kDetails);
  EXPECT_EQ(r.header.pieceCount, 1);
  ASSERT_GE(r.payload.size(), 72u);
  EXPECT_GE(e2e::rd32(r.payload, 12), 0);
  uint16_t at = e2e::rd16(r.payload, 16);
  ASSERT_GT(at, 0);
  uint16_t len = e2e::rd16(r.payload, at);
  ASSERT_LE(at + 2u + len, r.payload.size());
  EXPECT_EQ(std::string(r.payload.data() + at + 2, len), e2e::logPath(dir, "DET"));
  std::string stamp(r.payload.data() + 24, 26);
  EXPECT_EQ(stamp[4], '-');
  EXPECT_EQ(stamp[10], '-');
  EXPECT_EQ(stamp[19], '.');
  EXPECT_GT(e2e::rd32(r.payload, 64), 0);  // resident memory
  EXPECT_EQ(e2e::rd16(r.payload, 68), 0);  // no optional section
  stopCleanly(s, c);
}

TEST(KcapServer, GarbageOnTheQueueNeitherCrashesNorHangsIt) {
  klptest::TmpDir dir;
  Server s(dir, "GAR");
  ASSERT_TRUE(s.ready());
  RawClient c(s.queue());
  ASSERT_TRUE(c.ok());

  // Shorter than a header.
  ASSERT_TRUE(c.sendBytes("IPC:\0\0\0\0\1\0", 10));
  // Length word claims more than was sent, and less.
  auto m = RawClient::request(kStatus, 0, nullptr);
  int32_t claim = 4000;
  memcpy(m.data() + 12, &claim, 4);
  ASSERT_TRUE(c.sendBytes(m.data(), m.size()));
  claim = 20;
  memcpy(m.data() + 12, &claim, 4);
  ASSERT_TRUE(c.sendBytes(m.data(), m.size()));
  // Not our eye-catcher.
  m = RawClient::request(kStatus, 0, nullptr);
  memcpy(m.data(), "XYZ:", 4);
  ASSERT_TRUE(c.sendBytes(m.data(), m.size()));
  // Wrong version, function 0, no requester: not answered.
  m = RawClient::request(kStatus, 0, nullptr);
  int32_t version = 2;
  memcpy(m.data() + 8, &version, 4);
  ASSERT_TRUE(c.sendBytes(m.data(), m.size()));
  ASSERT_TRUE(c.send(0));
  m = RawClient::request(kStatus, 0, nullptr, 0);
  ASSERT_TRUE(c.sendBytes(m.data(), m.size()));
  // A queue name of the largest size, without NUL, to the thread that takes it.
  m = RawClient::request(kReinitq, 0, nullptr);
  m.resize(HSV_MAX_MSG_SIZE, 'Q');
  int32_t full = HSV_MAX_MSG_SIZE;
  memcpy(m.data() + 12, &full, 4);
  ASSERT_TRUE(c.sendBytes(m.data(), m.size()));
  Reply r;
  ASSERT_TRUE(c.receive(&r));
  EXPECT_EQ(r.header.func, kReinitq);
  // A CHGPARMS value without NUL, longer than any parameter.
  m = RawClient::request(kChgparms, 43, nullptr);
  m.resize(3000, 'W');
  int32_t l3000 = 3000;
  memcpy(m.data() + 12, &l3000, 4);
  ASSERT_TRUE(c.sendBytes(m.data(), m.size()));
  ASSERT_TRUE(c.receive(&r));
  EXPECT_EQ(r.header.func, kChgparms);
  EXPECT_EQ(r.raw.size(), 3000u);
  // A code nobody knows is answered with its echo.
  ASSERT_TRUE(c.ask(99, &r));
  EXPECT_EQ(r.header.func, 99);
  EXPECT_EQ(r.header.msgLength, 44);
  EXPECT_EQ(c.ask(-7, &r), true);
  EXPECT_EQ(r.header.func, -7);

  // Nothing else came back, and the server still answers.
  ASSERT_TRUE(c.ask(kStatus, &r));
  EXPECT_EQ(r.header.func, kStatus);
  EXPECT_EQ(e2e::threadStates(r).size(), 4u);
  ASSERT_TRUE(c.ask(kQryparms, &r));
  EXPECT_EQ(e2e::queryRecords(r.payload)["STARTMODE"].value, "WARMSI");
  EXPECT_TRUE(s.proc().running());

  // The thread that takes the queue commands logs the (cut) name.
  EXPECT_TRUE(e2e::waitFor(
      [&] { return s.log().find("reinitialized the send queue \"QQQQ") != std::string::npos; },
      10000));
  std::string log = s.log();
  // The run of bad messages is reported once; the next good one says so.
  EXPECT_EQ(e2e::countOf(log, "KLP0525E"), 1u) << log;
  EXPECT_EQ(e2e::countOf(log, "KLP0517I"), 1u) << log;
  EXPECT_NE(log.find("KLP0509W"), std::string::npos);
  EXPECT_NE(log.find("KLP0511W"), std::string::npos);
  stopCleanly(s, c);
}

TEST(KcapServer, ANamePrefixThatDoesNotFitIsReportedWithTheBuildersCode) {
  // 170 + ".KLP.KCAP" is more than the prefix's 160 characters.
  klptest::TmpDir dir;
  const std::string server = "CAPTURE_SERVER=" + std::string(170, 'N');
  const std::vector<std::vector<std::string>> runs = {
      {klptest::binPath("klpkcap"), server},
      {klptest::binPath("klpkccmd"), server, "STATUS"},
  };
  for (const auto& argv : runs) {
    klptest::ProcessResult pr = klptest::run(argv, {}, 30000);
    EXPECT_EQ(pr.exitCode, 12) << argv[0];
    EXPECT_NE(pr.out.find("a step failed with return code \"6005\": \"setEnvNamePrefix\""),
              std::string::npos)
        << argv[0] << "\n" << pr.out;
  }
}

TEST(KcapServer, RestartAfterKillReplacesTheStaleQueue) {
  klptest::TmpDir dir;
  {
    Server first(dir, "RST");
    ASSERT_TRUE(first.ready());
    first.proc().kill(SIGKILL);
    first.proc().wait(10000);
  }
  ASSERT_TRUE(klptest::queueExists(e2e::serverQueuePath(dir, "RST")));
  Server second(dir, "RST");
  // The log goes on from the first run: wait for the second creation.
  ASSERT_TRUE(e2e::waitFor([&] { return e2e::countOf(second.log(), "KLP0594I") == 2; }, 20000))
      << second.log();
  std::string log = second.log();
  size_t attached = log.rfind("KLP0592I"), destroyed = log.rfind("KLP0595I"),
         created = log.rfind("KLP0594I");
  ASSERT_NE(attached, std::string::npos) << log;
  ASSERT_NE(destroyed, std::string::npos) << log;
  EXPECT_LT(attached, destroyed);
  EXPECT_LT(destroyed, created);
  RawClient c(second.queue());
  ASSERT_TRUE(c.ok());
  Reply r;
  ASSERT_TRUE(c.ask(kStatus, &r));
  EXPECT_EQ(r.header.senderPid, second.pid());
  stopCleanly(second, c);
}

// ---------------------------------------------------------------------------
// The exported control interface, in this process, against the sample server.
// ---------------------------------------------------------------------------
class ControlInterface : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    if (klpGetProcessLogger() == nullptr) {
      msgLogger* logger = createMsgLoggerU(10, 0);
      logger->loadBuiltinMsgs(builtinMsgTable);
      klpSetProcessLogger(logger);
    }
    if (klpMainThread()->getState() == KLP_THREAD_EXIST) klpThread::prologue(klpMainThread());
  }
  void SetUp() override { klpEnvClear(klpGetEnv()); }  // the IPC directory is this test's
  void TearDown() override { klpEnvClear(klpGetEnv()); }

  static klpStatusRequest request(const char* server) {
    klpStatusRequest q;
    memset(&q, 0, sizeof q);
    strcpy(q.serverName, server);
    strcpy(q.schema, "KLP");
    return q;
  }
};

TEST_F(ControlInterface, StatusOfAKcapServerAndItsStop) {
  klptest::TmpDir dir;
  klpEnvClear(klpGetEnv());
  Server s(dir, "API");
  ASSERT_TRUE(s.ready());

  klpReleaseInfo rel{KLP_KIND_KCAP, 9, 1, 0};
  klpResultBlock res;
  klpStatusRequest q = request("api");  // names are upper-cased
  EXPECT_EQ(klpGetStatusSize(&rel, &q, &res), 0);
  EXPECT_EQ(q.statusSize, 2224);

  klpStatusFmt3 data;
  memset(&data, 0x5A, sizeof data);
  q.buffer = &data;
  q.bufferSize = sizeof data;
  ASSERT_EQ(klpGetStatus(&rel, &q, &res), 0) << res.text;
  EXPECT_EQ(q.requiredSize, 2224);
  EXPECT_EQ(data.format, 3);
  EXPECT_GE(data.upTime, 0);
  EXPECT_EQ(std::string(data.logFile), e2e::logPath(dir, "API"));
  EXPECT_EQ(data.activeSubs, 0);
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
}

TEST_F(ControlInterface, ASignalWhileACallerWaitsStillDestroysItsReplyQueue) {
  // A program that calls the control interface has no recovery point of
  // ours: the call's clean-ups must run all the same.
  klptest::TmpDir dir;
  klpEnvClear(klpGetEnv());
  Server s(dir, "HOLD");
  ASSERT_TRUE(s.ready());
  s.proc().kill(SIGSTOP);  // it takes the request but never answers
  int pid = fork();
  ASSERT_GE(pid, 0);
  if (pid == 0) {
    klpReleaseInfo rel{KLP_KIND_KCAP, 9, 1, 0};
    klpResultBlock res;
    klpStatusRequest q = request("HOLD");
    static klpStatusFmt3 data;
    q.buffer = &data;
    q.bufferSize = sizeof data;
    // The signal ends the call, not the caller's process.
    _exit(klpGetStatus(&rel, &q, &res) == 2010 ? 3 : 4);
  }
  std::string reply = s.queue() + ".CMD" + std::to_string(pid);
  EXPECT_TRUE(e2e::waitFor([&] { return klptest::queueExists(reply); }, 20000));
  // Signal it while it waits, once its request is on the server's queue.
  HSVResID sid;
  ASSERT_EQ(hsvIPCGetQueResID(s.queue().c_str(), HSV_QUEUE_RESID_OPTION, &sid), ECF_OK);
  HSVHIPCQueue serverQueue;
  ASSERT_EQ(serverQueue.attach(sid), ECF_OK);
  EXPECT_TRUE(e2e::waitFor([&] { return serverQueue.hasMessage(); }, 20000));
  serverQueue.detach();
  kill(pid, SIGINT);
  int status = 0;
  ASSERT_TRUE(e2e::waitFor([&] { return waitpid(pid, &status, WNOHANG) == pid; }, 20000));
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 3) << status;
  EXPECT_FALSE(klptest::queueExists(reply));
  s.proc().kill(SIGCONT);
  klpResultBlock res;
  EXPECT_EQ(klpStopProgram(KLP_KIND_KCAP, "HOLD", "KLP", 0, &res), 0) << res.text;
  EXPECT_EQ(s.proc().wait(30000).exitCode, 0);
  EXPECT_FALSE(klptest::queueExists(s.queue()));
}
