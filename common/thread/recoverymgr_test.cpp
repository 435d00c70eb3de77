#include "common/thread/recoverymgr.h"

#include <gtest/gtest.h>
#include <sys/resource.h>
#include <unistd.h>

#include <atomic>
#include <cinttypes>
#include <cstdio>
#include <filesystem>
#include <functional>
#include <thread>

#include "common/platform/hsv.h"
#include "common/thread/klpthread.h"
#include "common/util/klprc.h"
#include "tests/testing/klptest.h"

// The recovery handler issues its messages from within the signal handler, as the design
// asks; the signals of these tests are raised synchronously by the receiving thread itself.
extern "C" const char* __tsan_default_options() { return "report_signal_unsafe=0"; }

namespace {

using Logs = std::vector<std::string>;

void action(uint64_t arg) { printf("action %d\n", static_cast<int>(arg)), fflush(stdout); }

bool endsWithMarker(const std::string& s) {
  return s.rfind(std::string("***E**O**D**M***\0", 17)) == s.size() - 17;
}
HSVHIPCQueue* g_queue = nullptr;  // of the queue actions: outlives every frame

// Every routine of the folder that reports, with the records it logs (number, origin,
// destination kind, values in order); those of a stop and of the signal handler are with
// their tables.
TEST(ThreadRecords, EachRoutineLogsItsRecords) {
  klptest::mainThreadReady();
  klptest::TmpDir tmp;
  klptest::LogRecords records(tmp.path());
  char owner[32], ref[24];
  snprintf(owner, sizeof owner, "Initial:0x%08x",
           static_cast<unsigned>(reinterpret_cast<uintptr_t>(klpMainThread()) & 0xFFFFFFFFu));
  snprintf(ref, sizeof ref, "%016" PRIxPTR, reinterpret_cast<uintptr_t>(&g_queue));
  std::string dir = tmp.path() + "d", dump = dir + "/S1." + std::to_string(hsvProcessID()) + "." +
                                             std::to_string(hsvThreadID()) + ".DUMP";
  std::filesystem::create_directory(dir);
  HSVResID id;
  ASSERT_EQ(0u, hsvIPCGetQueResID((dir + "/Q.IPC").c_str(), HSV_QUEUE_RESID_OPTION, &id));
  auto queue = [&](void (*act)(uint64_t), bool create) {  // the queue is gone only when destroyed
    return [=] {
      g_queue = new HSVHIPCQueue;
      EXPECT_EQ(0u, create ? g_queue->create(id, HSV_MAX_MSG_SIZE, HSV_CREATE_OPTION) : g_queue->attach(id));
      act(reinterpret_cast<uint64_t>(&g_queue));
      EXPECT_TRUE(g_queue == nullptr && klptest::queueExists(dir + "/Q.IPC") == create);
    };
  };
  auto report = [](int sig, int global) {  // the signal report alone
    return [sig, global] {
      recoveryMgr m;
      m.signal = sig;
      erClearGlobalSignal();
      recoveryMgr::erWhatSignal(&m);
      EXPECT_EQ(global, erGetGlobalSignal()) << sig;
    };
  };
  const std::string what = "591|recoveryMgr::erWhatSignal|1|Initial|";
  struct { std::function<void()> run; Logs logs; } rows[] = {
      {[] {  // a new thread wants STOP, RESUME and SUSPEND; codes beyond 0..63 are refused
         klpThread t;
         for (int code = -1; code <= 64; ++code)
           EXPECT_EQ(code == 14 || code == 18 || code == 19, interestedInCmd(&t, code)) << code;
         setCmdInterest(&t, 20, 7);
         setCmdInterest(&t, 64, 1);
         EXPECT_EQ(7, interestedInCmd(&t, 20));
       },
       {"8006|klpThread::interestedInCmd|1|-1", "8006|klpThread::interestedInCmd|1|64",
        "8006|klpThread::setCmdInterest|1|64"}},
      {[] {  // unlocked by a thread that does not hold the lock
         OrdList l("Guarded");
         l.makeShared(nullptr, 1);
         l.lockList();
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
      {report(SIGINT, SIGINT), {what + "Handled|SIGINT"}},
      {report(SIGTERM, SIGTERM), {what + "Handled|SIGTERM"}},
      {report(SIGFPE, 0), {what + "Handled|SIGFPE"}},
      {report(SIGILL, 0), {what + "Handled|SIGILL"}},
      {report(SIGSEGV, 0), {"569|recoveryMgr::erWhatSignal|1|SIGSEGV", what + "Handled|SIGSEGV"}},
      {report(SIGBUS, 0), {what + "Non-handled|7"}},
      {report(0, 0), {}},
      {queue(erHSVIPCQdetach, true), {std::string("593|erHSVIPCQdestroy|1|") + ref}},
      {queue(erHSVIPCQdestroy, false), {std::string("595|erHSVIPCQdestroy|1|") + ref}},
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

// Signals, in forked children: the handler jumps, threads end and the process-wide record
// changes, none of which may touch the test process. The thread "Sig" adds the resources of
// its pass (passes split by '|'), then raises sig on itself (0: waits in state 7 for a stop).
// Flags: u no prologue; n no recovery point; c carries on after a return there (else ends
// with the code); l raises inside the thread-id list's lock; d gives its point up before it
// waits. The main thread: s stops it; r restarts it once ended; e catches ending signals
// first; C, O make a library call instead.
struct Plan { const char* adds; int sig; const char* flags; } g_plan;
int g_pass = 0;
std::atomic<bool> g_release{false};  // a waiting thread goes on when set
// Makes the stopper's message come first (a signal is no ordering the race detector sees).
pthread_mutex_t g_order = PTHREAD_MUTEX_INITIALIZER;
bool has(char flag) { return strchr(g_plan.flags, flag) != nullptr; }

void body(klpThread* t) {
  if (!has('u')) klpThread::prologue(t);
  if (!has('n') && KLP_SET_RECOVERY_POINT(t->rcvyMgr) != 0) {
    pthread_mutex_lock(&g_order);
    pthread_mutex_unlock(&g_order);
    int rc = recoveryMgr::erRecover(&t->rcvyMgr, t);
    printf("return %d rc=%d signal=%d\n", t->rcvyMgr.recoveries, rc, t->rcvyMgr.signal);
    fflush(stdout);
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
  erProcessSignals(&set);
  pthread_sigmask(SIG_UNBLOCK, &set, nullptr);
  raise(g_plan.sig);
  threadEnd(t, 0);
}

std::atomic<int> g_callerSaw{0};
std::atomic<bool> g_inCall{false};
void callerHandler(int sig) { g_callerSaw = sig; }

// Calls of the control interface with a clean-up registered and a SIGINT on the call's own
// thread or on another of the caller's; the caller's handler is back afterwards.
int libraryCall(bool otherThread) {
  std::thread other([otherThread] {
    if (otherThread && klptest::waitFor([] { return g_inCall.load(); })) raise(SIGINT);
  });
  char text[1028];
  size_t room = sizeof text;
  bool fits = true;
  for (int call = 0; call < (otherThread ? 1 : 2); ++call) {  // the second with the room the text took
    memset(text, 'x', sizeof text);
    text[sizeof text - 1] = '\0';
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
    fits = strlen(text) < room;
    room = strlen(text);
    printf("rc=%d\n", rc);
  }
  other.join();
  raise(SIGINT);  // the caller's own handler takes it now
  printf("%s %s %d\n", strstr(text, "SIGINT") ? "SIGINT" : text, fits ? "fits" : "overflows", g_callerSaw.load());
  return 0;
}

int drive(const Plan& plan) {
  g_plan = plan;
  signal(SIGINT, callerHandler);
  if (has('C') || has('O')) return libraryCall(has('O'));
  recoveryMgr::erReinstall();
  erClearGlobalSignal();
  struct rlimit none = {0, 0};
  setrlimit(RLIMIT_CORE, &none);
  if (has('e')) erCatchEndingSignals();
  OrdList list("Threads");
  list.makeShared(nullptr, 1);
  int code = -1, highest = 0;
  klpThread* t = createThread(&code, &list, body, "Sig", nullptr, 1, nullptr, 0, 0);
  auto is = [t](int32_t s) { return klptest::waitFor([&] { return t->getState() == s; }); };
  if (has('s') && is(KLP_THREAD_WAIT)) {
    pthread_mutex_lock(&g_order);
    printf("stop=%d\n", klpThread::stop(t));  // withdrawn: on its way out, or still waiting
    pthread_mutex_unlock(&g_order);
    g_release = true;
  }
  int supervised = has('r') && is(KLP_THREAD_STOP) ? supervise(&list, 0, &highest) : 0;
  void* ret = nullptr;
  pthread_join(t->handle, &ret);
  if (has('r')) printf("supervised=%d\n", supervised);  // printed once the new run is over
  printf("end=%ld code=%d global=%d\n", static_cast<long>(reinterpret_cast<intptr_t>(ret)),
         t->getEndCode(), erGetGlobalSignal());
  klpThreadIdList()->lockList();  // free again for the others
  klpThreadIdList()->unlockList();
  return 0;
}

TEST(SigRecovery, SignalsComeBackToTheThreadsRecoveryPointWithItsCleanUpsOrEndTheProcess) {
  klptest::mainThreadReady();
  klptest::TmpDir tmp;
  klptest::LogRecords records(tmp.path());
  const std::string sig = "591|recoveryMgr::erWhatSignal|1|Sig|";
  const std::string stop = "590|klpThread::stop|1|Initial|0|Sig";
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
