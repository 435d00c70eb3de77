// Threads: their life, supervision and stops; recovery from signals and what it logs.
#include "common/thread/klpthread.h"

#include <gtest/gtest.h>
#include <sys/resource.h>

#include <atomic>
#include <cinttypes>
#include <filesystem>
#include <functional>
#include <thread>

#include "common/msg/klplog.h"
#include "common/platform/hsv.h"
#include "common/thread/queue.h"
#include "common/thread/recoverymgr.h"
#include "common/util/klprc.h"
#include "tests/testing/klptest.h"

// The handler logs from within the signal handler; these signals are raised by the thread itself.
extern "C" const char* __tsan_default_options() { return "report_signal_unsafe=0"; }

namespace {

std::atomic<bool> g_release{false};  // W and H threads end when set
std::atomic<int> g_runs{0}, g_endWith{0}, g_seenState{0};
std::atomic<klpThread*> g_seenCurrent{nullptr};
sigset_t g_seenMask;
Queue g_queue;

// By the name's first letter: E ends with g_endWith; A with 9, then 0; W works, H rests uncancellable till
// released; R waits on g_queue; D works on a connection till interrupted, then ends with 5; N just returns.
void body(klpThread* t) {
  klpThread::prologue(t);
  char k = t->name[0];
  int run = ++g_runs;
  if (k == 'N') return;
  if (k == 'E' || k == 'A') threadEnd(t, k == 'E' ? g_endWith.load() : run == 1 ? 9 : 0);
  if (k == 'W') {  // as a thread that ran before, still with its old end code
    t->setEndCode(g_endWith);
    g_seenState = t->getState();
    g_seenCurrent = currentThread();
    pthread_sigmask(SIG_BLOCK, nullptr, &g_seenMask);
    logKlpMsg(8006, "body", KLP_DEST_SEVERITY, "fromWorker", nullptr, 0);
  }
  if (k == 'H') pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, nullptr);
  klpDbConn* c = k == 'D' ? t->connect('O', "DB1", 1208) : nullptr;
  t->setState(k == 'W' || k == 'D' ? KLP_THREAD_RUN : KLP_THREAD_REST);
  for (int32_t wait = 60000; k == 'R'; wait = 60000) g_queue.getHeadWithWait(&wait);
  while (!g_release && !(c && __atomic_load_n(&c->interrupts, __ATOMIC_RELAXED))) hsvSleep(2);
  threadEnd(t, c ? 5 : 0);
}

bool waitState(klpThread* t, int32_t s) { return klptest::waitFor([&] { return t->getState() == s; }); }
bool onIdList(klpThread* t) { return t->tid.oleAnchor == klpThreadIdList(); }

// Real threads on a shared list, with the main thread registered first.
struct MtThread : ::testing::Test {
  klptest::TmpDir tmp;
  klptest::LogRecords records{tmp.path()};
  OrdList list{"Threads"};
  int highest = 3;
  void SetUp() override {
    klptest::mainThreadReady();
    g_release = false, g_runs = 0;
    list.makeShared(nullptr, 1);
  }
  klpThread* make(const char* name, int restart = 1, int critical = 0, int shared = 0) {
    int code = -1;
    klpThread* t = createThread(&code, &list, body, name, "MYDB", restart,
                                name[0] == 'W' ? malloc(8) : nullptr, shared, critical);
    EXPECT_EQ(0, code);
    return t;
  }
};

// Exits 0 when just one of two threads took the first prologue; the held id-list lock lets both come by.
void firstPrologueRace() {
  OrdList* ids = klpThreadIdList();
  ids->makeShared("KlpThreadIDList", 0), ids->lockList();
  klpThread a, b;
  std::thread ta(klpThread::prologue, &a), tb(klpThread::prologue, &b);
  hsvSleep(200);  // not needed for the verdict: lets both threads come by
  ids->unlockList();
  ta.join(), tb.join();
  _exit((strcmp(a.name, "Initial") == 0) + (strcmp(b.name, "Initial") == 0) == 1 && ids->count == 2 ? 0 : 1);
}

TEST(KlpThreadFirst, OnlyOneOfTwoThreadsAtOnceTakesTheFirstPrologue) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");  // a process where no prologue ran yet
  EXPECT_EXIT(firstPrologueRace(), ::testing::ExitedWithCode(0), "");
}

TEST_F(MtThread, ACreatedThreadRunsUnderItsNameAndAStopRemovesEndsOrWithdrawsIt) {
  klpThread* t = make("Worker");
  ASSERT_TRUE(waitState(t, KLP_THREAD_RUN));
  EXPECT_TRUE(g_seenCurrent == t && g_seenState == KLP_THREAD_INIT && onIdList(t));
  // Sent to the process, SIGINT and SIGTERM are the main thread's; a stop must still reach it.
  EXPECT_TRUE(sigismember(&g_seenMask, SIGINT) && sigismember(&g_seenMask, SIGTERM) &&
              !sigismember(&g_seenMask, erStopSignal()));
  EXPECT_TRUE(threadStateByName(&list, "Worker") == KLP_THREAD_RUN && !threadStateByName(&list, "Work"));
  EXPECT_TRUE(!strcmp("Worker", t->cmdList->qName) && t->cmdList->locked && t->cmdList->ownerCheck() &&
              !strncmp(t->dbCtx.dbAlias, "MYDB    ", 8));
  g_release = true;
  ASSERT_TRUE(waitState(t, KLP_THREAD_STOP));
  EXPECT_EQ(KLP_RC_THREAD_ENDED, t->getEndCode());  // 0 is stored as 2011
  EXPECT_TRUE(t->userData == nullptr && !onIdList(t));  // an ended thread's id may be reused
  EXPECT_EQ(KLP_RC_THREAD_ENDED, klpThread::stop(t));
  std::vector<std::string> got = records.take(true);  // the logger names the issuing thread
  EXPECT_EQ("Worker>8006|body|1|fromWorker", got.empty() ? "" : got[0]);
  struct { const char* name; int32_t ready; int rc; const char* log; } rows[] = {  // ready: stopped in
      {"Ender", KLP_THREAD_STOP, 77, "590|klpThread::stop|1|Initial|77|Ender"},  // its end code
      {"NoEnd", KLP_THREAD_STOP, 2011, "590|klpThread::stop|1|Initial|2011|NoEnd"},  // returned
      {"DbWorker", KLP_THREAD_RUN, 5, "590|klpThread::stop|1|Initial|0|DbWorker"},  // interrupted
      {"Rester", KLP_THREAD_REST, 2009, "590|klpThread::stop|1|Initial|0|Rester"},  // withdrawn
  };
  g_release = false, g_endWith = 77;
  OrdListElement pending[2];  // other threads' commands on the shared list
  for (OrdListElement& e : pending) klpSharedCmdList()->putTail(&e);
  for (const auto& row : rows) {
    t = make(row.name, 1, 0, row.name[0] == 'N');
    ASSERT_TRUE(waitState(t, row.ready)) << row.name;
    EXPECT_EQ(row.rc, klpThread::stop(t)) << row.name;
    EXPECT_EQ(row.rc == KLP_RC_RECOVERED, list.count) << row.name;
    EXPECT_EQ(std::vector<std::string>{row.log}, records.take());
  }
  OrdList* s = klpSharedCmdList();  // locked, owner checked; a stop empties a thread's own list only
  EXPECT_TRUE(s->count == 2 && s->locked && s->ownerCheck() && !strcmp(s->qName, "KlpList"));
  for (OrdListElement& e : pending) EXPECT_EQ(&e, klpSharedCmdList()->getHead());
  t = klpThreadOf(list.olHead);
  EXPECT_TRUE(t->ole.withdrawn && !list.browseHead() && !threadStateByName(&list, "Rester"));
  void* ret = nullptr;
  pthread_join(t->handle, &ret);
  EXPECT_TRUE(ret == PTHREAD_CANCELED && !onIdList(t));
  OrdListElement x;  // the queue it waited on is as it was: unlocked, no waiter, no post left
  g_queue.putTailAndNotify(&x);
  int32_t wait = 1000;
  EXPECT_TRUE(g_queue.getHeadWithWait(&wait) == &x && g_queue.waiters == 0 && g_queue.waitpost.wait(0) == ECF_TIMEOUT);
  t->setState(KLP_THREAD_STOP), t->hasHandle = 0;  // gone: now it can be removed
  klpThread::stop(t);
}

// After a failed stop, stop all rests (state 5) unless waiting for the database (8), then restores.
TEST_F(MtThread, StopAllToleratesOnlyAnUnstoppableHoldLThreadAndRestsAfterAFailure) {
  EXPECT_EQ(0, stopAll(nullptr));
  for (const char* name : {"HoldLThread", "HoldOn"}) {
    g_release = false;
    klpThread *hold = make(name), *done = make("Ended"), *m = klpMainThread();
    ASSERT_TRUE(waitState(hold, KLP_THREAD_REST) && waitState(done, KLP_THREAD_STOP));
    int32_t before = name[4] == 'L' ? KLP_THREAD_RUN : KLP_THREAD_DBWAIT;
    m->setState(before);
    std::atomic<bool> rested{false}, stopped{false};
    std::thread watcher([&] { for (; !stopped; hsvSleep(1)) rested = rested || m->getState() == KLP_THREAD_REST; });
    EXPECT_EQ(name[4] == 'L' ? 0 : KLP_RC_RECOVERED, stopAll(&list)) << name;
    stopped = true, watcher.join();
    EXPECT_TRUE(rested == (before == KLP_THREAD_RUN) && m->getState() == before);
    EXPECT_TRUE(hold->ole.withdrawn && list.count == 1);  // only the withdrawn one is left
    m->setState(KLP_THREAD_RUN);
    g_release = true;
    ASSERT_TRUE(waitState(hold, KLP_THREAD_STOP));
    EXPECT_EQ(KLP_RC_THREAD_ENDED, klpThread::stop(hold));
  }
}

TEST_F(MtThread, SupervisionJudgesTheSetRestartsAndRemoves) {
  // Threads ("!" critical, "-" no restart), end code, stopping, per pass result and threads left, highest.
  struct { std::vector<const char*> threads; int endWith, stopping; std::vector<std::pair<int, int>> passes;
           int highest; } rows[] = {
      {{}, 0, 0, {{2007, 0}}, 3},
      {{"W"}, 0, 0, {{415, 1}}, 3},                 // alive, none critical
      {{"W", "W!"}, 0, 0, {{0, 2}}, 3},             // a critical one lives
      {{"W!", "E-"}, 9, 0, {{2006, 1}}, 9},         // one finished
      {{"E"}, 2001, 0, {{2007, 1}, {2007, 0}}, 3},  // 2001: kept one pass (as 2011)
      {{"A"}, 0, 0, {{415, 1}, {2007, 0}}, 3},      // restarted after 9, removed after 0
      {{"W", "E-"}, 2012, 0, {{2012, 1}}, 2012},    // a shutdown
      {{"E-"}, 2012, 0, {{2012, 0}}, 2012},
      {{"E"}, 9, 1, {{2007, 0}}, 9},                // stopping: not restarted
      {{"W!"}, 7, 0, {{0, 1}}, 3},                  // a live critical one's code counts
      {{"W!"}, 7, 1, {{0, 1}}, 7},                  // only while stopping, and not 2001
      {{"W!"}, 2001, 1, {{0, 1}}, 3},
  };
  EXPECT_EQ(0, supervise(nullptr, 0, &highest));
  for (const auto& row : rows) {
    SCOPED_TRACE(row.threads.size() ? row.threads.back() : "none");
    g_release = false, g_runs = 0, g_endWith = row.endWith, highest = 3;
    for (const char* n : row.threads) make(n, n[1] != '-', n[1] == '!');
    for (auto [rc, left] : row.passes) {
      for (OrdListElement* e = list.browseHead(); e; e = OrdList::browsePrev(e))  // W runs, others end
        ASSERT_TRUE(waitState(klpThreadOf(e), klpThreadOf(e)->name[0] == 'W' ? KLP_THREAD_RUN : 6));
      EXPECT_TRUE(supervise(&list, row.stopping, &highest) == rc && list.count == left) << rc;
    }
    EXPECT_EQ(row.highest, highest);
    g_release = true;
    for (OrdListElement* e; (e = list.browseHead()) != nullptr; klpThread::stop(klpThreadOf(e)))
      ASSERT_TRUE(waitState(klpThreadOf(e), KLP_THREAD_STOP));
  }
  EXPECT_EQ(1, g_runs.load());
}

using Logs = std::vector<std::string>;
void action(uint64_t arg) { printf("action %d\n", static_cast<int>(arg)), fflush(stdout); }
bool endsWithMarker(const std::string& s) { return s.rfind(std::string("***E**O**D**M***\0", 17)) == s.size() - 17; }
HSVHIPCQueue* g_ipcQueue = nullptr;  // of the queue actions: outlives every frame

// Routines with the records they log (a stop's and the signal handler's are with their tables).
TEST_F(MtThread, EachRoutineLogsItsRecords) {
  char owner[32], ref[24];
  snprintf(owner, sizeof owner, "Initial:0x%08x",
           static_cast<unsigned>(reinterpret_cast<uintptr_t>(klpMainThread()) & 0xFFFFFFFFu));
  snprintf(ref, sizeof ref, "%016" PRIxPTR, reinterpret_cast<uintptr_t>(&g_ipcQueue));
  std::string dir = tmp.path() + "d", dump = dir + "/S1." + std::to_string(hsvProcessID()) + "." +
                                             std::to_string(hsvThreadID()) + ".DUMP";
  std::filesystem::create_directory(dir);
  HSVResID id;
  ASSERT_EQ(0u, hsvIPCGetQueResID((dir + "/Q.IPC").c_str(), HSV_QUEUE_RESID_OPTION, &id));
  const std::string what = "591|recoveryMgr::erWhatSignal|1|Initial|";
  struct { std::function<void()> run; Logs logs; } rows[] = {
      {[] {  // connections are made for kind O only; a stop interrupts the work in progress
         klpThread t;
         klpDbConn* o = t.getThrdCtlConn('O', "ORCL", 1208);
         EXPECT_TRUE(o && o == t.getThrdCtlConn('O', "ORCL", 1208) && o != t.getThrdCtlConn('O', "ORCL", 819));
         EXPECT_EQ(nullptr, t.getThrdCtlConn('D', "SAMPLE", 1208));
         klpDbConn* d = t.connect('D', "SAMPLE", 1208);
         EXPECT_EQ(d, t.getThrdCtlConn('D', "SAMPLE", 1208));
         t.interruptDbWork(), t.detachCurrentConn();  // the current connection,
         t.interruptDbWork();                         // then, with none, the database context
         EXPECT_TRUE(d->interrupts == 1 && t.dbCtx.interrupts == 1);
         t.cleanupConns();  // the sanitizer build reports a leak if one is left
       },
       {}},
      {[] {  // a new thread wants STOP, RESUME and SUSPEND; codes beyond 0..63 are refused
         klpThread t;
         for (int code = -1; code <= 64; ++code)
           EXPECT_EQ(code == 14 || code == 18 || code == 19, interestedInCmd(&t, code)) << code;
         setCmdInterest(&t, 20, 7), setCmdInterest(&t, 64, 1);
         EXPECT_EQ(7, interestedInCmd(&t, 20));
       },
       {"8006|klpThread::interestedInCmd|1|-1", "8006|klpThread::interestedInCmd|1|64",
        "8006|klpThread::setCmdInterest|1|64"}},
      {[] {  // unlocked by a thread that does not hold the lock
         OrdList l("Guarded");
         l.makeShared(nullptr, 1), l.lockList();
         std::thread([&] { EXPECT_EQ(1005, l.unlockList()); }).join();
         EXPECT_TRUE(l.depth() == 1 && l.owner() == klpMainThread());  // still ours
         EXPECT_EQ(0, l.unlockList());
       },
       {std::string("624|OrdList::unlock|1|UNKNOWN|Guarded|0|Thread does not hold lock|") + owner + "|1"}},
      {[] {  // a broken chain: the element is unlinked all the same
         OrdList l("Broken");
         OrdListElement a, b, c;
         for (OrdListElement* e : {&a, &b, &c}) l.putTail(e);
         b.oleNext = nullptr;
         EXPECT_EQ(0, ordListDeChain(&b));
         EXPECT_TRUE(l.count == 2 && !b.oleAnchor && !b.olePrev && !c.oleNext);
       },
       {"8000|ordListDeChain|1|KlpOLE:|Broken"}},
      {[] {  // a resource is the current thread's: none for a thread that is not registered
         std::thread([] { EXPECT_EQ(nullptr, addRcvyRes(action, 0)); }).join();
         recoveryRes* r = addRcvyRes(action, 7);
         EXPECT_TRUE(r && r->ole.oleAnchor == &klpMainThread()->rcvyMgr.resList && r->registered > 0);
         endRcvyRes(r);
       },
       {"589|findRcvyMgr|1|findRcvyMgr|602|findThread", "589|addRcvyRes|1|addRcvyRes|602|findRcvyMgr"}},
      {[] {  // the signal report alone; none of these is kept as the global one
         for (int sig : {SIGFPE, SIGILL, SIGSEGV, SIGBUS, 0}) {
           recoveryMgr m;
           m.signal = sig;
           erClearGlobalSignal();
           recoveryMgr::erWhatSignal(&m);
           EXPECT_EQ(0, erGetGlobalSignal()) << sig;
         }
       },
       {what + "Handled|SIGFPE", what + "Handled|SIGILL", "569|recoveryMgr::erWhatSignal|1|SIGSEGV",
        what + "Handled|SIGSEGV", what + "Non-handled|7"}},
      {[&] {  // the queue is gone only when destroyed
         for (bool create : {true, false}) {
           g_ipcQueue = new HSVHIPCQueue;
           EXPECT_EQ(0u, create ? g_ipcQueue->create(id, HSV_MAX_MSG_SIZE, HSV_CREATE_OPTION)
                                : g_ipcQueue->attach(id));
           (create ? erHSVIPCQdetach : erHSVIPCQdestroy)(reinterpret_cast<uint64_t>(&g_ipcQueue));
           EXPECT_TRUE(g_ipcQueue == nullptr && klptest::queueExists(dir + "/Q.IPC") == create);
         }
       },
       {std::string("593|erHSVIPCQdestroy|1|") + ref, std::string("595|erHSVIPCQdestroy|1|") + ref}},
      {[&] {  // a dump, then one more appended
         char path[1200];
         ASSERT_EQ(0, erDumpStackTraceTo(dir.c_str(), "S1", SIGSEGV, nullptr, nullptr, path, 1200));
         std::string first = klptest::readFile(dump);
         ASSERT_EQ(0, erDumpStackTraceTo(dir.c_str(), "S1", SIGSEGV, nullptr, nullptr));
         std::string both = klptest::readFile(dump);
         EXPECT_TRUE(dump == path && endsWithMarker(first) && endsWithMarker(both) &&
                     both.size() > first.size() && both.rfind(first, 0) == 0);
       },
       {"8053|erDumpStackTraceInfo|1|SIGSEGV|" + dump, "8053|erDumpStackTraceInfo|1|SIGSEGV|" + dump}},
      {[&] { erDumpStackTraceTo(dir.c_str(), "  ", SIGFPE, nullptr, nullptr); },  // no prefix
       {"8053|erDumpStackTraceInfo|1|SIGFPE|" + dir + "/" + dump.substr(dir.size() + 3)}},
      {[&] { EXPECT_EQ(803, erDumpStackTraceTo((dir + "/no").c_str(), "S1", 8, nullptr, nullptr)); },
       {"589|erDumpStackTraceInfo|1|erDumpStackTraceInfo|803|HSVTrapFile::isValid",
        "8999|erDumpStackTraceInfo|r8|" + dir + "/no" + dump.substr(dir.size())}},
      {[&] { EXPECT_EQ(803, erDumpStackTraceTo(std::string(2000, 'd').c_str(), "", 8, nullptr, nullptr)); },
       {"589|erDumpStackTraceInfo|1|erDumpStackTraceInfo|803|HSVTrapFile::isValid",
        "8999|erDumpStackTraceInfo|r8|dump file name too long"}},
  };
  for (size_t i = 0; i < sizeof rows / sizeof rows[0]; ++i) {
    rows[i].run();
    EXPECT_EQ(rows[i].logs, records.take()) << "row " << i;
  }
}

// Signals, in forked children. Thread "Sig" adds its pass's resources (passes split by '|'),
// then raises sig (0: waits in state 7). Flags: u no prologue; n no recovery point; c carries
// on after a return (else ends with its code); l raises in the id list's lock; d gives its point
// up first. Main thread: s stops it; r restarts it; e catches ending signals; C, O library calls.
struct Plan { const char* adds; int sig; const char* flags; } g_plan;
int g_pass = 0;
// Makes the stopper's message come first (a signal is no ordering the race detector sees).
pthread_mutex_t g_order = PTHREAD_MUTEX_INITIALIZER;
bool has(char flag) { return strchr(g_plan.flags, flag) != nullptr; }

void sigBody(klpThread* t) {
  if (!has('u')) klpThread::prologue(t);
  if (!has('n') && KLP_SET_RECOVERY_POINT(t->rcvyMgr) != 0) {
    pthread_mutex_lock(&g_order), pthread_mutex_unlock(&g_order);
    int rc = recoveryMgr::erRecover(&t->rcvyMgr, t);
    printf("return %d rc=%d signal=%d\n", t->rcvyMgr.recoveries, rc, t->rcvyMgr.signal), fflush(stdout);
    if (!has('c')) threadEnd(t, rc);
  }
  int at = 0;  // the resources of this pass
  for (const char* p = g_plan.adds; *p != '\0'; ++p)
    if (*p == '|') ++at; else if (at == g_pass) addRcvyRes(action, *p - '0');
  ++g_pass;
  if (has('l')) klpThreadIdList()->lockList();
  if (has('d')) recoveryMgr::erUndoRecovery(&t->rcvyMgr);  // as a thread that is ending
  if (g_plan.sig == 0) t->setState(KLP_THREAD_WAIT);
  for (int i = 0; i < 2000 && g_plan.sig == 0 && !g_release; ++i) hsvSleep(5);
  sigset_t set;  // created threads block SIGINT and SIGTERM: unblocked on purpose
  erProcessSignals(&set), pthread_sigmask(SIG_UNBLOCK, &set, nullptr);
  raise(g_plan.sig);
  threadEnd(t, 0);
}

std::atomic<int> g_callerSaw{0};
std::atomic<bool> g_inCall{false};
void callerHandler(int sig) { g_callerSaw = sig; }

// Interface calls with a clean-up and a SIGINT on their own thread or another; the caller's handler comes back.
int libraryCall(bool otherThread) {
  std::thread other([otherThread] {
    if (otherThread && klptest::waitFor([] { return g_inCall.load(); })) raise(SIGINT);
  });
  char text[1028];
  size_t room = sizeof text;
  bool fits = true;
  for (int call = 0; call < (otherThread ? 1 : 2); ++call) {  // the second with the room the text took
    memset(text, 'x', sizeof text - 1), text[sizeof text - 1] = '\0';
    int rc = [&] {
      erLibraryCall call;
      if (KLP_SET_CALL_POINT(call) != 0) return call.recover(text, room);
      recoveryRes* res = addRcvyRes(action, 4);
      g_inCall = true;
      for (int i = 0; i < 2000 && otherThread; ++i) hsvSleep(5);
      if (!otherThread) raise(SIGINT);
      endRcvyRes(res);
      return 0;
    }();
    fits = strlen(text) < room, room = strlen(text);
    printf("rc=%d\n", rc);
  }
  other.join();
  raise(SIGINT);  // the caller's own handler takes it now
  printf("%s %s %d\n", strstr(text, "SIGINT") ? "SIGINT" : text, fits ? "fits" : "overflows", g_callerSaw.load());
  return 0;
}

int drive(const Plan& plan) {
  g_plan = plan, g_release = false;  // a waiting thread goes on when set
  signal(SIGINT, callerHandler);
  if (has('C') || has('O')) return libraryCall(has('O'));
  struct rlimit none = {0, 0};
  setrlimit(RLIMIT_CORE, &none), recoveryMgr::erReinstall(), erClearGlobalSignal();
  if (has('e')) erCatchEndingSignals();
  OrdList list("Threads");
  list.makeShared(nullptr, 1);
  int code = -1, highest = 0;
  klpThread* t = createThread(&code, &list, sigBody, "Sig", nullptr, 1, nullptr, 0, 0);
  if (has('s') && waitState(t, KLP_THREAD_WAIT)) {
    pthread_mutex_lock(&g_order);
    printf("stop=%d\n", klpThread::stop(t));  // withdrawn: on its way out, or still waiting
    pthread_mutex_unlock(&g_order), g_release = true;
  }
  int supervised = has('r') && waitState(t, KLP_THREAD_STOP) ? supervise(&list, 0, &highest) : 0;
  void* ret = nullptr;
  pthread_join(t->handle, &ret);
  if (has('r')) printf("supervised=%d\n", supervised);  // printed once the new run is over
  printf("end=%ld code=%d global=%d\n", static_cast<long>(reinterpret_cast<intptr_t>(ret)),
         t->getEndCode(), erGetGlobalSignal());
  klpThreadIdList()->lockList(), klpThreadIdList()->unlockList();  // free again for the others
  return 0;
}

TEST_F(MtThread, SignalsComeBackToTheThreadsRecoveryPointWithItsCleanUpsOrEndTheProcess) {
  const std::string sig = "591|recoveryMgr::erWhatSignal|1|Sig|", stop = "590|klpThread::stop|1|Initial|0|Sig";
  const std::string ret = "return 1 rc=2009 signal=", ended = "end=2009 code=2009 global=";
  // The signal that ends the process (0: none), the trap line's part (null: none), output, records.
  struct { Plan plan; int endSig; const char* trap; std::string out; Logs logs; } rows[] = {
      // Resources last first, on the first return only; the fourth return ends the thread.
      {{"12|3", SIGINT, "c"}, 0, nullptr, "action 2\naction 1\n" + ret + "2\nreturn 2 rc=2010 signal=2\n"
       "return 3 rc=2010 signal=2\nend=2010 code=2010 global=2\n", Logs(3, sig + "Handled|SIGINT")},
      // Inside the thread-id list's lock, which the jump abandons; the stop's signal as SIGTERM.
      {{"", SIGINT, "l"}, 0, nullptr, ret + "2\n" + ended + "2\n", {sig + "Handled|SIGINT"}},
      {{"", erStopSignal(), "l"}, 0, nullptr, ret + "15\n" + ended + "15\n", {sig + "Handled|SIGTERM"}},
      {{"7", SIGINT, "n"}, 0, nullptr, "action 7\n" + ended + "2\n",
       {"589|signalHandler|1|signalHandler|2009|setRecoveryPoint",
        "8999|signalHandler|r8|the thread has no recovery point",
        "591|signalHandler|1|Sig|Non-handled|SIGINT"}},
      {{"", SIGINT, "unl"}, 0, nullptr, "end=2009 code=0 global=2\n",
       {"589|findRcvyMgr|1|findRcvyMgr|602|findThread", "589|signalHandler|1|signalHandler|602|findRcvyMgr",
        "591|signalHandler|1|Unknown|Non-handled|2"}},
      // A stop signals a waiting thread; never the process, also when the thread gave its point up.
      {{"", 0, "s"}, 0, nullptr, "stop=2009\n" + ret + "15\n" + ended + "15\n",
       {stop, sig + "Handled|SIGTERM"}},
      {{"", 0, "sd"}, 0, nullptr, "stop=2009\nend=2011 code=2011 global=0\n", {stop}},
      // Started again, a thread has a fresh recovery state: its resource runs at the first return.
      {{"|5", SIGINT, "r"}, 0, nullptr, ret + "2\naction 5\n" + ret + "2\nsupervised=415\n" + ended + "2\n",
       Logs(2, sig + "Handled|SIGINT")},
      {{"", 0, "C"}, 0, nullptr, "action 4\nrc=2010\naction 4\nrc=2010\nSIGINT fits 2\n", {}},
      {{"", 0, "O"}, 0, nullptr, "action 4\nrc=2010\nSIGINT fits 2\n", {}},
      // A fault is never recovered: one trap line, the fault's own end; no message, no clean-up.
      {{"9", SIGSEGV, ""}, SIGSEGV, "KLP trap: signal 11 (SIGSEGV) in process ", "", {}},
      {{"9", SIGBUS, ""}, SIGBUS, ", thread ", "", {}},
      {{"9", SIGILL, ""}, SIGILL, " (Sig)\n", "", {}},
      {{"", SIGSEGV, "un"}, SIGSEGV, "KLP trap: signal 11 (", "", {}},
      // Any other signal whose default ends the process: the clean-ups first.
      {{"1", SIGHUP, "e"}, SIGHUP, nullptr, "action 1\n", {sig + "Non-handled|1"}},
      {{"3", SIGPIPE, "e"}, SIGPIPE, nullptr, "action 3\n", {sig + "Non-handled|13"}},
  };
  for (size_t i = 0; i < sizeof rows / sizeof rows[0]; ++i) {
    auto c = klptest::inChild(tmp.path(), [&] { return drive(rows[i].plan); });
    EXPECT_TRUE(c.signal == rows[i].endSig && c.exitCode == (rows[i].endSig ? -1 : 0)) << "row " << i;
    EXPECT_EQ(rows[i].out, c.out) << "row " << i;
    EXPECT_EQ(rows[i].logs, records.take()) << "row " << i;
    EXPECT_EQ(rows[i].trap != nullptr, c.err.find("KLP trap: signal") != std::string::npos) << i;
    EXPECT_NE(std::string::npos, c.err.find(rows[i].trap ? rows[i].trap : "")) << "row " << i << c.err;
  }
  for (const auto& entry : std::filesystem::directory_iterator(tmp.path()))
    EXPECT_EQ(std::string::npos, entry.path().string().find(".DUMP")) << entry.path();
}

}  // namespace
