// The command engine inside this process: requests handed to its per-message
// step and to the loop itself, with thread objects that run no OS thread, so
// that what each thread received can be looked at directly.
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstring>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "common/env/klpenv.h"
#include "common/ipc/cmdsengine.h"
#include "common/ipc/ipcmsg.h"
#include "common/msg/klplog.h"
#include "common/msg/msglogger.h"
#include "common/parms/klpparm.h"
#include "common/thread/klpthread.h"
#include "common/thread/ordlist.h"
#include "tests/e2e/e2e_support.h"
#include "xqpub/xqpubparms.h"

namespace {

constexpr int kStop = 14, kStatus = 15, kPrune = 22;

int g_dbRc = 0;
int testDbCheck(char* text, size_t len) {
  snprintf(text, len, "%s", g_dbRc == 0 ? "AVAILABLE" : "DOWN");
  return g_dbRc;
}

class Engine : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    if (klpGetProcessLogger() == nullptr) {
      msgLogger* logger = createMsgLoggerU(5, 0);
      logger->loadBuiltinMsgs(builtinMsgTable);
      klpSetProcessLogger(logger);
    }
    if (klpMainThread()->getState() == KLP_THREAD_EXIST) klpThread::prologue(klpMainThread());
  }

  void SetUp() override {
    dir_ = std::make_unique<klptest::TmpDir>();
    ParmEntry table[XQPUB_PARM_COUNT];
    buildXqpubParmTable(table);
    int rc = 0;
    parms_ = std::make_unique<xqpubParms>(table, XQPUB_PARM_COUNT, &rc);
    ASSERT_EQ(rc, 0);
    parms_->setParm(0, "ENG", PARM_SRC_COMMANDLINE);
    klpSetCurrentParms(parms_.get());
    klpEnv* env = klpGetEnv();
    klpEnvClear(env);
    ASSERT_EQ(setEnvNamePrefix(env, "KCAP"), 0);
    g_dbRc = 0;
    cmdsSetDbStatusCheck(testDbCheck);
    threads_.makeShared("EngThreads", 1);
    cmdsInitState(&st_, CMDS_MODE_NORMAL, &stopFlag_);

    replyPath_ = e2e::replyQueuePath(*dir_, "ENG", getpid());
    HSVResID id;
    ASSERT_EQ(hsvIPCGetQueResID(replyPath_.c_str(), HSV_QUEUE_RESID_OPTION, &id), ECF_OK);
    ASSERT_EQ(reply_.create(id, HSV_MAX_MSG_SIZE, HSV_CREATE_OPTION), ECF_OK);
  }

  void TearDown() override {
    while (OrdListElement* e = threads_.getHead()) {
      klpThread* t = klpThreadOf(e);
      if (t->cmdList != nullptr) {
        t->cmdList->delList();
        delete t->cmdList;
      }
      delete t;
    }
    reply_.destroy();
    EXPECT_FALSE(klptest::queueExists(replyPath_));
    delEnvIpcQRcvHdl(klpGetEnv());
    klpEnvClear(klpGetEnv());
    cmdsSetDbStatusCheck(nullptr);
    klpSetCurrentParms(nullptr);
    parms_.reset();
    dir_.reset();
  }

  // A thread object with its own command list, on the engine's list, that
  // runs nothing.
  klpThread* addThread(const char* name, int32_t state, std::vector<int> interests = {}) {
    klpThread* t = new klpThread();
    t->setName(name);
    t->setState(state);
    t->critical = 1;
    for (int code : {14, 18, 19}) setCmdInterest(t, code, 1);
    for (int code : interests) setCmdInterest(t, code, 1);
    t->cmdList = new OrdList();
    t->cmdList->makeShared(name, 1);
    threads_.putTail(&t->ole);
    return t;
  }

  int handle(const std::vector<char>& m) {
    return cmdsHandleMessage(&st_, &threads_, m.data(), m.size());
  }

  bool receive(e2e::Reply* r, int timeoutMs = 2000) {
    if (reply_.waitForMessage(timeoutMs) != ECF_OK) return false;
    char buf[HSV_MAX_MSG_SIZE];
    size_t got = 0;
    if (reply_.get(buf, sizeof buf, &got, 100) != ECF_OK) return false;
    memcpy(&r->header, buf, IPC_HEADER_SIZE);
    r->raw.assign(buf, buf + got);
    r->payload.assign(buf + IPC_HEADER_SIZE, buf + got);
    return true;
  }

  static MsgQe* takeQe(klpThread* t) { return reinterpret_cast<MsgQe*>(t->cmdList->getHead()); }

  // Takes a reply's pieces as the client does until it is whole; the
  // headers of the pieces that came are kept.
  std::vector<char> gatherReply(std::vector<IpcMsg>* headers) {
    IpcGather g;
    int32_t left = 0;
    do {
      e2e::Reply r;
      if (!receive(&r)) return {};
      headers->push_back(r.header);
      IpcMsgView v;
      if (ipcDecodeMsg(r.raw.data(), r.raw.size(), &v) != 0 || g.add(v, &left) != 0) return {};
    } while (left > 0);
    char* buf = g.release();
    int32_t len = 0;
    memcpy(&len, buf + 4, 4);
    std::vector<char> payload(buf + 8, buf + 8 + len);
    free(buf);
    return payload;
  }

  std::string logText() const { return klptest::readFile(dir_->path() + "eng.log"); }

  std::unique_ptr<klptest::TmpDir> dir_;
  std::unique_ptr<xqpubParms> parms_;
  OrdList threads_;
  cmdsState st_;
  int32_t stopFlag_ = 0;
  HSVHIPCQueue reply_;
  std::string replyPath_;
};

TEST_F(Engine, StatusHasOneRecordPerThreadInListOrderAndALongOneComesInPieces) {
  addThread("BehinderWorkerThread", KLP_THREAD_RUN);
  addThread("Second", KLP_THREAD_DBWAIT);
  addThread("Third", KLP_THREAD_REST);
  const struct {
    int threads;
    size_t pieces;
    int32_t lastLength;
  } cases[] = {
      {3, 1, 136},         // 76 + 20 x 3
      {250, 2, 44 + 980},  // 5032 payload bytes: 4052, then 980
  };
  for (const auto& c : cases) {
    while (threads_.count < c.threads) addThread("More", KLP_THREAD_REST);
    std::vector<IpcMsg> pieces;
    ASSERT_EQ(handle(e2e::RawClient::request(kStatus, 0, nullptr)), 0);
    std::vector<char> p = gatherReply(&pieces);
    ASSERT_EQ(pieces.size(), c.pieces);
    for (const IpcMsg& h : pieces) {
      EXPECT_EQ(h.func, kStatus);
      EXPECT_EQ(h.senderPid, getpid());
      EXPECT_EQ(h.pieceCount, static_cast<int32_t>(c.pieces));
    }
    EXPECT_EQ(pieces.back().msgLength, c.lastLength);
    EXPECT_EQ(e2e::rd32(p, 0), 0);
    EXPECT_EQ(e2e::rd32(p, 8), c.threads);
    EXPECT_STREQ(p.data() + 12, "BehinderWorker");
    EXPECT_EQ(e2e::rd32(p, 12 + 16), KLP_THREAD_RUN);
    EXPECT_STREQ(p.data() + 32, "Second");
    EXPECT_EQ(e2e::rd32(p, 32 + 16), KLP_THREAD_DBWAIT);
  }
}

TEST_F(Engine, OnlyInterestedThreadsReceiveAndARequestWithoutRequesterIsNotAnswered) {
  klpThread* pruner = addThread("PruneThread", KLP_THREAD_REST, {kPrune});
  klpThread* other = addThread("Other", KLP_THREAD_REST);
  ASSERT_EQ(handle(e2e::RawClient::request(kPrune, 0, nullptr, 0)), 0);
  EXPECT_EQ(pruner->cmdList->count, 1);
  EXPECT_EQ(other->cmdList->count, 0);
  MsgQe* qe = takeQe(pruner);
  ASSERT_NE(qe, nullptr);
  EXPECT_STREQ(qe->ole.eyeCatcher, "ITC:");
  EXPECT_EQ(qe->QeFunc, kPrune);
  EXPECT_EQ(qe->QeResponseId, 0);
  deleteMsgQe(qe);
  e2e::Reply r;
  EXPECT_FALSE(receive(&r, 300));

  // With a requester the request is answered after the thread got it.
  ASSERT_EQ(handle(e2e::RawClient::request(kPrune, 0, nullptr)), 0);
  EXPECT_EQ(pruner->cmdList->count, 1);
  ASSERT_TRUE(receive(&r));
  EXPECT_EQ(r.header.func, kPrune);
  EXPECT_EQ(r.header.msgLength, 44);
}

TEST_F(Engine, StopIsAnsweredOnceAndTheStopSequenceSkipsStoppedThreads) {
  klpThread* a = addThread("A", KLP_THREAD_REST);
  klpThread* b = addThread("B", KLP_THREAD_STOP);
  ASSERT_EQ(handle(e2e::RawClient::request(kStop, 0, nullptr)), 0);
  EXPECT_EQ(stopFlag_, 1);
  EXPECT_EQ(st_.stopping, 1);
  e2e::Reply r;
  ASSERT_TRUE(receive(&r));
  EXPECT_EQ(r.header.func, kStop);
  EXPECT_EQ(a->cmdList->count, 1);  // the request itself, by interest
  EXPECT_EQ(b->cmdList->count, 1);
  // Already stopping: the sequence sends nothing more.
  EXPECT_EQ(cmdsStartStop(&st_, &threads_), 0);
  EXPECT_EQ(a->cmdList->count, 1);

  cmdsState fresh;
  cmdsInitState(&fresh, CMDS_MODE_NORMAL, nullptr);
  a->cmdList->delList();
  b->cmdList->delList();
  EXPECT_EQ(cmdsStartStop(&fresh, &threads_), 0);
  EXPECT_EQ(a->cmdList->count, 1);
  EXPECT_EQ(b->cmdList->count, 0);  // already stopped
  MsgQe* qe = takeQe(a);
  ASSERT_NE(qe, nullptr);
  EXPECT_EQ(qe->QeFunc, kStop);
  EXPECT_EQ(qe->QeResponseId, 0);
  deleteMsgQe(qe);
}

TEST_F(Engine, ARequesterThatTakesNoRepliesIsDroppedNotWaitedFor) {
  // Its reply queue is full. A taker makes room once the engine is done
  // (after 5 s if the engine is still waiting for room): what reaches the
  // queue then shows whether the engine waited.
  const struct {
    const char* what;
    int waiting;
    int threads;
    bool firstPiece;  // the STATUS reply's first piece found room
  } cases[] = {
      {"full: nothing goes", 10, 3, false},
      {"room for the first of two pieces only", 9, 250, true},
  };
  IpcMsg* other = nullptr;
  ASSERT_EQ(createReplyMsg(&other, 44, 99, 1), 0);
  for (const auto& c : cases) {
    SCOPED_TRACE(c.what);
    klptest::ProcessLogger log(5, dir_->path(), "eng.log");
    while (threads_.count < c.threads) addThread("T", KLP_THREAD_REST);
    hsvRC prc;
    for (int i = 0; i < c.waiting; ++i) ASSERT_EQ(putIpcMsgWait(&reply_, other, 0, &prc), 0);
    std::atomic<bool> done{false};
    std::thread taker([&] {
      e2e::waitFor([&] { return done.load(); }, 5000);
      char buf[HSV_MAX_MSG_SIZE];
      size_t got = 0;
      reply_.get(buf, sizeof buf, &got, 1000);
    });
    EXPECT_EQ(handle(e2e::RawClient::request(kStatus, 0, nullptr)), 0);
    done = true;
    taker.join();
    // Left: the others but the one taken, then the pieces that found room.
    std::vector<std::pair<int32_t, int32_t>> left, want(c.waiting - 1, {99, 0});
    for (e2e::Reply r; receive(&r, 0);) left.emplace_back(r.header.func, r.header.pieceNo);
    if (c.firstPiece) want.emplace_back(kStatus, 1);
    EXPECT_EQ(left, want);
    std::string text = logText();
    EXPECT_EQ(e2e::countOf(text, "KLP0508E"), 1u) << text;
    EXPECT_NE(text.find("\"805\""), std::string::npos) << text;
    remove((dir_->path() + "eng.log").c_str());
  }
  freeIpcMsg(other);
}

TEST_F(Engine, ACommandListIsCappedButTheStopSequenceStillReachesIt) {
  klptest::ProcessLogger log(5, dir_->path(), "eng.log");
  klpThread* stuck = addThread("Stuck", KLP_THREAD_REST, {kPrune});
  klpThread* taking = addThread("Taking", KLP_THREAD_REST, {kPrune});
  for (int i = 0; i < 102; ++i) {
    ASSERT_EQ(handle(e2e::RawClient::request(kPrune, 0, nullptr, 0)), 0);
    deleteMsgQe(takeQe(taking));  // this one takes its commands
  }
  EXPECT_EQ(stuck->cmdList->count, 100);
  EXPECT_EQ(taking->cmdList->count, 0);
  std::string text = logText();
  EXPECT_EQ(e2e::countOf(text, "KLP8054E"), 2u) << text;
  EXPECT_NE(text.find("The thread \"Stuck\" has \"100\" commands waiting; the command with "
                      "function code \"22\" is not passed to it."),
            std::string::npos)
      << text;
  EXPECT_EQ(cmdsStartStop(&st_, &threads_), 0);
  EXPECT_EQ(stuck->cmdList->count, 101);
}

TEST_F(Engine, WithoutAServerQueueTheEngineReports804) {
  int32_t flag = 0;
  EXPECT_EQ(cmdsEngine(&threads_, CMDS_MODE_NORMAL, &flag), 804);
}

TEST_F(Engine, OnePassKeepsTheQueueAndAnUnavailableDatabaseGives929) {
  klpEnv* env = klpGetEnv();
  ASSERT_EQ(setEnvIpcQRcvHdl(env), 0);
  std::string queue = e2e::serverQueuePath(*dir_, "ENG");
  ASSERT_TRUE(klptest::queueExists(queue));
  addThread("A", KLP_THREAD_REST);
  int32_t flag = 0;
  EXPECT_EQ(cmdsEngine(&threads_, CMDS_MODE_ONE_PASS, &flag), 0);
  EXPECT_TRUE(klptest::queueExists(queue));
  g_dbRc = 929;
  EXPECT_EQ(cmdsEngine(&threads_, CMDS_MODE_ONE_PASS, &flag), 929);
  EXPECT_TRUE(klptest::queueExists(queue));
  delEnvIpcQRcvHdl(env);
  EXPECT_FALSE(klptest::queueExists(queue));
}

TEST_F(Engine, ThreadsThatDoNotStopEndTheLoopAfterTheGraceAndTheQueueGoes) {
  klpEnv* env = klpGetEnv();
  ASSERT_EQ(setEnvIpcQRcvHdl(env), 0);
  std::string queue = e2e::serverQueuePath(*dir_, "ENG");
  klpThread* stubborn = addThread("Stubborn", KLP_THREAD_REST);
  {
    HSVResID id;
    HSVHIPCQueue server;
    ASSERT_EQ(hsvIPCGetQueResID(queue.c_str(), HSV_QUEUE_RESID_OPTION, &id), ECF_OK);
    ASSERT_EQ(server.attach(id), ECF_OK);
    auto m = e2e::RawClient::request(kStop, 0, nullptr);
    ASSERT_EQ(server.put(m.data(), m.size()), ECF_OK);
    server.detach();
  }
  auto start = std::chrono::steady_clock::now();
  int32_t flag = 0;
  EXPECT_EQ(cmdsEngine(&threads_, CMDS_MODE_NORMAL, &flag), 0);
  auto secs = std::chrono::duration_cast<std::chrono::seconds>(std::chrono::steady_clock::now() -
                                                               start)
                  .count();
  EXPECT_EQ(flag, 1);
  EXPECT_GE(secs, 8);
  e2e::Reply r;
  ASSERT_TRUE(receive(&r));
  EXPECT_EQ(r.header.func, kStop);
  EXPECT_EQ(stubborn->cmdList->count, 1);
  EXPECT_FALSE(klptest::queueExists(queue));
}

}  // namespace
