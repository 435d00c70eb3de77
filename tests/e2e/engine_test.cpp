// The command engine in this process, with thread objects that run no OS thread, its log recorded.
#include <fnmatch.h>

#include <atomic>
#include <chrono>
#include <future>
#include <thread>

#include "common/env/klpenv.h"
#include "common/ipc/cmdsengine.h"
#include "common/parms/klpparm.h"
#include "common/thread/klpthread.h"
#include "common/thread/ordlist.h"
#include "common/thread/recoverymgr.h"
#include "tests/e2e/e2e_support.h"

namespace {

using e2e::Ints;
using e2e::RawClient;
constexpr int kStop = 14, kStatus = 15, kChgparms = 20, kPrune = 22;
// Roles the engine knows: 5 ends a one-pass server without critical threads;
// in an "xqapply" program flag 18 and text 34 decide that and whether 18 may be set.
constexpr int kTerm = 5, kApplyFlag = 18, kApplyText = 34, kInterval = 30, kPath = 7;

int g_dbRc = 0;
int testDbCheck(char* text, size_t len) {
  snprintf(text, len, "%s", g_dbRc == 0 ? "AVAILABLE" : "DOWN");
  return g_dbRc;
}

class Engine : public ::testing::Test {
 protected:
  void SetUp() override {
    if (klpMainThread()->getState() == KLP_THREAD_EXIST) klpThread::prologue(klpMainThread());
    // The roles above, server name and schema, and one parameter fixed while the server runs.
    std::vector<ParmEntry> table;
    for (int i = 0; i <= kApplyText; ++i) {
      const char* text = i == 0 ? "ENG" : i == 2 ? "KLP" : i == kPath ? "/p" : i == kApplyText ? "" : nullptr;
      int changeable = i == kTerm || i == kApplyFlag || i == kApplyText || i == kInterval;
      table.push_back(i == kInterval ? makeParmEntry(i, "COMMIT_INTERVAL", 0, PARM_INTEGER, 100, 600000, 500, nullptr, 0, 1, 1)
                                     : makeParmEntry(i, ("P" + std::to_string(i)).c_str(), 0, text ? PARM_STRING : PARM_BOOLEAN,
                                                     -1, text ? 1040 : -1, -1, text, 0, 1, changeable));
    }
    int rc = 0;
    parms_ = std::make_unique<klpParmClass>(table.data(), static_cast<int>(table.size()), &rc);
    ASSERT_EQ(rc, 0);
    klpSetCurrentParms(parms_.get());
    klpEnvClear(klpGetEnv());
    ASSERT_EQ(setEnvNamePrefix(klpGetEnv(), "KCAP"), 0);
    program("klpkcap");
    g_dbRc = 0;
    cmdsSetDbStatusCheck(testDbCheck);
    threads_.makeShared("EngThreads", 1);
    cmdsInitState(&st_, CMDS_MODE_NORMAL, &stopFlag_);
    ASSERT_TRUE(e2e::openQueue(reply_, e2e::replyQueuePath(dir_, "ENG", getpid()), true));
  }
  void TearDown() override {
    clearThreads();
    reply_.destroy();
    delEnvIpcQRcvHdl(klpGetEnv());
    klpEnvClear(klpGetEnv());
    cmdsSetDbStatusCheck(nullptr);
    klpSetCurrentParms(nullptr);
    erClearGlobalSignal();
  }
  void clearThreads() {
    while (OrdListElement* e = threads_.getHead()) {
      klpThread* t = klpThreadOf(e);
      if (t->cmdList) t->cmdList->delList();
      delete t->cmdList;
      delete t;
    }
  }
  // The records since the last look, one a line, against a fnmatch pattern.
  template <typename What>
  void expectRecords(const std::string& pattern, const What& what) {
    std::string got;
    for (const auto& r : log_.take()) got += (got.empty() ? "" : "\n") + r;
    EXPECT_EQ(fnmatch(pattern.c_str(), got.c_str(), 0), 0) << what << "\n" << got;
  }
  static void program(const char* name) {
    snprintf(klpGetEnv()->programName, sizeof klpGetEnv()->programName, "%s", name);
  }

  // A thread object with its own command list, on the engine's list, running nothing.
  klpThread* addThread(const char* name, int32_t state, std::vector<int> interests = {}, int critical = 1) {
    klpThread* t = new klpThread();
    t->setName(name);
    t->setState(state);
    t->critical = critical;
    t->restart = 0;
    for (int code : interests) setCmdInterest(t, code, 1);
    t->cmdList = new OrdList();
    t->cmdList->makeShared(name, 1);
    threads_.putTail(&t->ole);
    return t;
  }
  int handle(const std::vector<char>& m) { return cmdsHandleMessage(&st_, &threads_, m.data(), m.size()); }
  bool receive(e2e::Reply* r, int timeoutMs = 2000) { return e2e::takeReply(reply_, r, timeoutMs); }
  // The function of the first command waiting for t, or -1.
  static int32_t takeFunc(klpThread* t) {
    auto* qe = reinterpret_cast<MsgQe*>(t->cmdList->getHead());
    int32_t f = qe ? qe->QeFunc : -1;
    deleteMsgQe(qe);
    return f;
  }
  // The server's queue, with one request on it so that a pass does not idle.
  void serverQueueWith(const std::vector<char>& m) {
    if (!getEnvIpcQRcvHdl(klpGetEnv())) { ASSERT_EQ(setEnvIpcQRcvHdl(klpGetEnv()), 0); }
    ASSERT_TRUE(RawClient(e2e::serverQueuePath(dir_, "ENG"), false).sendBytes(m));
  }

  klptest::TmpDir dir_;
  klptest::LogCapture log_;
  std::unique_ptr<klpParmClass> parms_;
  OrdList threads_;
  cmdsState st_;
  int32_t stopFlag_ = 0;
  HSVHIPCQueue reply_;
};

std::vector<char> req(int32_t func, int32_t subFunc = 0, int32_t pid = getpid(), int32_t version = 1) {
  auto m = RawClient::request(func, subFunc, nullptr, pid);
  memcpy(m.data() + 8, &version, 4);
  return m;
}

// Each request's answer and log; 60 to 62 are the thread's to answer, TRCSTART 1 (trace-on notice) nobody's.
TEST_F(Engine, EachRequestIsAnsweredByItsCodeAndLogged) {
  klpThread* pruner = addThread("PruneThread", KLP_THREAD_REST, {kPrune, kStop});
  addThread("BehinderWorkerThread", KLP_THREAD_DBWAIT);  // cut to 14 characters
  addThread("C", KLP_THREAD_RUN);
  const std::string get = "525 cmdsEngine 1 \\[NOT SET\\]\n589 cmdsEngine 1 cmdsEngine|816|HSVHIPCQueue::get\n"
                          "8999 cmdsEngine 1 a message of ";
  auto perThread = [](const std::string& r) { return r + "\n" + r + "\n" + r; };
  const struct {
    std::vector<char> msg;
    int32_t length;  // of the reply, -1: none
    std::string records;
  } rows[] = {
      {req(kStatus), 44 + 12 + 20 * 4, ""},   {req(10), 44, ""},          {req(10, 1), -1, ""},
      {req(60), -1, ""},                      {req(61), -1, ""},          {req(62), -1, ""},
      {req(16), 44, ""},  // codes no thread can declare interest in are reported per thread
      {req(99), 44, perThread("8006 klpThread::interestedInCmd 1 99")},
      {req(-7), 44, perThread("8006 klpThread::interestedInCmd 1 -7")},
      {req(59), 60, ""},                      {req(kPrune, 0, 0), -1, ""},
      {req(0, 0, 4711), -1, "511 cmdsEngine 1 4711"},
      {req(kStatus, 0, 1, 2), -1, "509 cmdsEngine 1 2"},
      {std::vector<char>(10, 'I'), -1, get + "10 bytes is not a command message*"},
      {std::vector<char>(43, 'I'), -1, ""},  // reported once until a get succeeds again
      {req(17), -2, "517 cmdsEngine 1 \\[NOT SET\\]"},  // -2: any length
      {req(kPrune, 0, 4711), -1, "597 cmdsEngine 1 (mqueue, /klpq.*, 48)|" + dir_.path() +
                                     "ENG.KLP.KCAP.IPC.CMD4711|*\n506 cmdsEngine 1 K Capture Commands"},
      {req(kStop), 44, "522 cmdsEngine 0 STOP"},
  };
  for (const auto& r : rows) {
    int32_t func = r.msg.size() >= 20 ? e2e::rd32(r.msg, 16) : 0;
    ASSERT_EQ(handle(r.msg), 0) << func;
    e2e::Reply got;
    bool answered = receive(&got, 0);  // replies are put before the step returns
    EXPECT_EQ(answered ? (r.length == -2 ? -2 : got.header.msgLength) : -1, r.length) << func;
    if (answered) { EXPECT_EQ((Ints{got.header.func, got.header.senderPid}), (Ints{func, getpid()})); }
    if (func == 17) { EXPECT_EQ(std::string(got.payload.data() + 2, 8), "KLPQRYMG"); }
    if (func == 59) { EXPECT_EQ(std::string(got.payload.data(), 16), std::string("klpSISize: \0\3\0\0\0", 16)); }
    if (answered && func == kStatus) {  // one record per thread, in list order, and room for one more
      EXPECT_EQ((Ints{e2e::rd32(got.payload, 0), e2e::rd32(got.payload, 4), e2e::rd32(got.payload, 8),
                           e2e::rd32(got.payload, 28), e2e::rd32(got.payload, 48), e2e::rd32(got.payload, 68)}),
                (Ints{0, 0, 3, KLP_THREAD_REST, KLP_THREAD_DBWAIT, KLP_THREAD_RUN}));
      EXPECT_EQ(std::string(got.payload.data() + 12) + "," + std::string(got.payload.data() + 32, 16),
                "PruneThread," + std::string("BehinderWorker\0\0", 16));
    }
    expectRecords(r.records, func);
  }
  // The code went to the interested thread only; STOP set the caller's flag once.
  EXPECT_EQ((Ints{takeFunc(pruner), takeFunc(pruner), takeFunc(pruner), takeFunc(pruner)}),
            (Ints{kPrune, kPrune, kStop, -1}));
  EXPECT_EQ((Ints{stopFlag_, st_.stopping}), (Ints{1, 1}));
}

// A changeable parameter changes by its type, echoed either way; "xqapply" may not set 18 while 34 is set.
TEST_F(Engine, ChgparmsChangesByTypeAndIsEchoed) {
  const struct {
    const char* program;
    int index;
    const char* value;
    const char* after;  // the parameter's value text afterwards
    int source;
    const char* records = "";
  } rows[] = {
      {"klpkcap", kTerm, "yes", "Y", 3}, {"klpkcap", kTerm, "n", "N", 3}, {"klpkcap", kTerm, "Y", "Y", 3},
      {"klpkcap", kTerm, "No", "N", 3}, {"klpkcap", kTerm, "MAYBE", "N", 3}, {"klpkcap", kTerm, "YESYESYES", "N", 3},
      {"klpkcap", kInterval, "1000", "1000", 3}, {"klpkcap", kInterval, "12abc", "1000", 3},
      {"klpkcap", kInterval, "50", "1000", 3, "503 klpParmClass:setParm 2 50|COMMIT_INTERVAL"},
      {"klpkcap", kInterval, "99999999999", "1000", 3}, {"klpkcap", kInterval, "+2000", "2000", 3},
      {"klpkcap", kPath, "/elsewhere", "/p", 0}, {"klpkcap", kApplyText, "P1", "P1", 3},
      {"klpkcap", kApplyFlag, "Y", "Y", 3}, {"klpkcap", kApplyFlag, "N", "N", 3}, {"xqapply1", kApplyFlag, "N", "N", 3},
      {"xqapply1", kApplyFlag, "y", "N", 3, "9011 cmdsEngine 1 "}, {"xqapply1", kApplyText, "", "", 3},
      {"xqapply1", kApplyFlag, "y", "Y", 3}, {"xqapply1", 4000, "7", nullptr, 0},
  };
  for (const auto& r : rows) {
    program(r.program);
    std::string value = r.value;
    auto m = RawClient::request(kChgparms, r.index, &value);
    ASSERT_EQ(handle(m), 0);
    e2e::Reply got;
    ASSERT_TRUE(receive(&got, 0)) << r.value;
    EXPECT_EQ(got.header.subFunc, r.index);
    EXPECT_EQ(got.payload, std::vector<char>(m.begin() + 44, m.end()));
    if (r.after) {
      const ParmEntry* p = parms_->peekSlot(r.index);
      std::string now = p->type == PARM_BOOLEAN   ? (p->boolValue ? "Y" : "N")
                        : p->type == PARM_INTEGER ? std::to_string(p->intValue)
                                                  : (p->strValue ? p->strValue : "");
      EXPECT_EQ(now, r.after) << r.program << " " << r.index << "=" << r.value;
      EXPECT_EQ(parms_->peekSlot(r.index)->source, r.source) << r.index << "=" << r.value;
    }
    expectRecords(r.records, r.value);
  }
}

// One pass (mode 2): 415 (threads alive, none critical) stops a server unless flag 5 is not set;
// an "xqapply" program stops only when its flag 18 or text 34 says so.
TEST_F(Engine, OnePassOutcomes) {
  const std::string rrs = "590 klpThread::stop 1 *|952|Ended\n534 cmdsEngine 1 ENG|RRS NOT AVAILABLE";
  const struct {
    const char* program;
    int term, flag;
    const char* text;
    int state, critical, endCode;  // of the one thread
    int dbRc, signal, rc;
    bool stopped;  // the thread received STOP from the stop sequence
    std::string records;
  } rows[] = {
      {"klpkcap", 0, 0, "", KLP_THREAD_REST, 1, 0, 0, 0, 0, false, ""},
      {"klpkcap", 0, 0, "", KLP_THREAD_REST, 0, 0, 0, 0, 0, false, ""},
      {"klpkcap", 1, 0, "", KLP_THREAD_REST, 0, 0, 0, 0, 0, true, ""},
      {"xqapply1", 1, 0, "", KLP_THREAD_REST, 0, 0, 0, 0, 0, false, ""},
      {"xqapply1", 1, 1, "", KLP_THREAD_REST, 0, 0, 0, 0, 0, true, ""},
      {"xqapply1", 1, 0, "P", KLP_THREAD_REST, 0, 0, 0, 0, 0, true, ""},
      {"xqapply1", 0, 0, "P", KLP_THREAD_REST, 0, 0, 0, 0, 0, false, ""},
      {"klpkcap", 0, 0, "", KLP_THREAD_STOP, 1, 952, 0, 0, 952, false, rrs},
      {"klpkcap", 0, 0, "", KLP_THREAD_REST, 1, 0, 929, 0, 929, false, ""},
      {"klpkcap", 0, 0, "", KLP_THREAD_REST, 1, 0, 0, SIGINT, 0, true,
       "8999 cmdsEngine 1 A global signal was received by \"KlpKCcmd\". Stop cmdsEngine(), stop all "
       "threads and exit.*"},
  };
  for (const auto& r : rows) {
    program(r.program);
    parms_->setParmBool(kTerm, r.term, 3);
    parms_->setParmBool(kApplyFlag, r.flag, 3);
    parms_->setParm(kApplyText, r.text, 3);
    klpThread* t = addThread("Ended", r.state, {}, r.critical);
    t->setEndCode(r.endCode);
    g_dbRc = r.dbRc;
    if (r.signal) erSetGlobalSignal(r.signal);
    serverQueueWith(req(kPrune, 0, 0));
    log_.take();
    int32_t flag = 0;
    EXPECT_EQ(cmdsEngine(&threads_, CMDS_MODE_ONE_PASS, &flag), r.rc) << r.program << " " << r.state;
    EXPECT_EQ(r.state == KLP_THREAD_STOP ? -1 : takeFunc(t), r.stopped ? kStop : -1) << r.program;
    expectRecords(r.records, r.program);
    EXPECT_EQ(erGetGlobalSignal(), 0);
    EXPECT_TRUE(klptest::queueExists(e2e::serverQueuePath(dir_, "ENG")));  // kept in one-pass mode
    clearThreads();
  }
  delEnvIpcQRcvHdl(klpGetEnv());
  log_.take();
  EXPECT_EQ(cmdsEngine(&threads_, CMDS_MODE_NORMAL, nullptr), 804);
  expectRecords("589 cmdsEngine 1 cmdsEngine|804|getEnvIpcQRcvHdl", "no queue");

  // The stop sequence's grace, by program name.
  for (auto [name, grace] : {std::pair{"xqapply", 180}, {"xqapplyZ", 180}, {"xqappl", 8}, {"apply", 8}}) {
    program(name);
    cmdsState st;
    cmdsInitState(&st, CMDS_MODE_NORMAL, nullptr);
    EXPECT_EQ(st.grace, grace) << name;
  }
}

// The loop in mode 0 on its own thread; the test thread plays the threads' part.
std::future<int> loop(OrdList* threads, int32_t* flag) {
  return std::async(std::launch::async, [=] { return cmdsEngine(threads, CMDS_MODE_NORMAL, flag); });
}
bool ended(std::future<int>& run) { return run.wait_for(std::chrono::seconds(0)) == std::future_status::ready; }

// A database gone down starts the stop sequence (2006); then 929 and 534, and the server's queue goes.
TEST_F(Engine, ADatabaseThatGoesDownStopsTheServerWith929) {
  klpThread* a = addThread("A", KLP_THREAD_REST);
  ASSERT_EQ(setEnvIpcQRcvHdl(klpGetEnv()), 0);
  log_.take();
  g_dbRc = 929;  // the first check comes after more than 4 seconds
  int32_t flag = 0;
  {
    std::future<int> run = loop(&threads_, &flag);
    ASSERT_TRUE(e2e::waitFor([&] {  // under the list's lock: the engine fills it meanwhile
      a->cmdList->lockList();
      bool some = a->cmdList->count > 0;
      return a->cmdList->unlockList() == 0 && some;
    }, 15000));
    EXPECT_EQ(takeFunc(a), kStop);
    a->setState(KLP_THREAD_STOP);
    EXPECT_TRUE(e2e::waitFor([&] { return ended(run); }, 15000));
    EXPECT_EQ((Ints{run.get(), flag}), (Ints{929, 0}));
  }
  expectRecords("590 klpThread::stop 1 *|0|A\n534 cmdsEngine 1 ENG|DOWN\n595 Klpenv:delEnvIpcQRcvHdl 0 *",
                 "database down");
  EXPECT_FALSE(klptest::queueExists(e2e::serverQueuePath(dir_, "ENG")));
}

// An "apply" program's grace ends only while its WorkerThread rests; it checks no database.
TEST_F(Engine, TheGraceOfAnApplyProgramWaitsForItsWorkerToRest) {
  program("applyX");
  g_dbRc = 929;
  klpThread* worker = addThread("WorkerThread", KLP_THREAD_RUN, {kStop});
  serverQueueWith(req(kStop));
  auto start = std::chrono::steady_clock::now();
  int32_t flag = 0;
  {
    std::future<int> run = loop(&threads_, &flag);
    // Past the grace, still running: without the rule it would have ended.
    std::this_thread::sleep_for(std::chrono::milliseconds(10500));
    EXPECT_FALSE(ended(run));
    worker->setState(KLP_THREAD_REST);
    EXPECT_TRUE(e2e::waitFor([&] { return ended(run); }, 5000));
    EXPECT_EQ((Ints{run.get(), flag}), (Ints{0, 1}));
  }
  EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::seconds(9));
  e2e::Reply r;
  ASSERT_TRUE(receive(&r));
  EXPECT_EQ(r.header.func, kStop);
  EXPECT_EQ((Ints{takeFunc(worker), takeFunc(worker)}), (Ints{kStop, -1}));  // the request itself
  EXPECT_FALSE(klptest::queueExists(e2e::serverQueuePath(dir_, "ENG")));
}

// A requester whose reply queue is full is dropped: a first piece goes only with room at once.
TEST_F(Engine, ARequesterThatTakesNoRepliesIsDroppedNotWaitedFor) {
  const struct {
    int waiting, threads;
    bool firstPiece;  // the STATUS reply's first piece found room
  } cases[] = {{10, 3, false}, {9, 250, true}};
  IpcMsg* other = nullptr;
  ASSERT_EQ(createReplyMsg(&other, 44, 99, 1), 0);
  for (const auto& c : cases) {
    while (threads_.count < c.threads) addThread("T", KLP_THREAD_REST);
    hsvRC prc;
    for (int i = 0; i < c.waiting; ++i) ASSERT_EQ(putIpcMsgWait(&reply_, other, 0, &prc), 0);
    std::atomic<bool> done{false};
    std::thread taker([&] {  // makes room once the engine is done, or after 5 s
      e2e::waitFor([&] { return done.load(); }, 5000);
      e2e::Reply r;
      receive(&r, 1000);
    });
    EXPECT_EQ(handle(req(kStatus)), 0);
    done = true;
    taker.join();
    std::vector<std::pair<int32_t, int32_t>> left, want(c.waiting - 1, {99, 0});
    for (e2e::Reply r; receive(&r, 0);) left.emplace_back(r.header.func, r.header.pieceNo);
    if (c.firstPiece) want.emplace_back(kStatus, 1);
    EXPECT_EQ(left, want) << c.threads;
    expectRecords("508 cmdsEngine 1 (mqueue, /klpq.*, 48)\n589 cmdsEngine 1 cmdsEngine|805|HSVHIPCQueue::put\n"
                   "8999 cmdsEngine 1 *", c.threads);
  }
  freeIpcMsg(other);
}

// A thread that takes no commands gets at most 100; the stop sequence still reaches it.
TEST_F(Engine, ACommandListIsCappedButTheStopSequenceStillReachesIt) {
  klpThread* stuck = addThread("Stuck", KLP_THREAD_REST, {kPrune});
  klpThread* taking = addThread("Taking", KLP_THREAD_REST, {kPrune});
  for (int i = 0; i < 102; ++i) {
    ASSERT_EQ(handle(req(kPrune, 0, 0)), 0);
    EXPECT_EQ(takeFunc(taking), kPrune);
  }
  EXPECT_EQ(stuck->cmdList->count, 100);
  expectRecords("8054 cmdsEngine 1 Stuck|100|22\n8054 cmdsEngine 1 Stuck|100|22", "cap");
  EXPECT_EQ(cmdsStartStop(&st_, &threads_), 0);
  EXPECT_EQ(threads_.unlockList(), 1005);  // the stop sequence let go of the thread list
  EXPECT_EQ((Ints{stuck->cmdList->count, taking->cmdList->count}), (Ints{101, 1}));
  EXPECT_EQ(cmdsStartStop(&st_, &threads_), 0);  // once stopping, nothing more is sent
  EXPECT_EQ(taking->cmdList->count, 1);
}

}  // namespace
