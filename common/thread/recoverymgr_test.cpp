#include "common/thread/recoverymgr.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <cinttypes>
#include <cstdio>
#include <filesystem>
#include <string>

#include "common/platform/hsv.h"
#include "common/thread/klpthread.h"
#include "common/thread/thread_testutil.h"
#include "common/util/klprc.h"

// The recovery handler issues its messages (and, for a fault, writes the
// dump) from within the signal handler, as the design asks; the signals of
// these tests are raised synchronously by the receiving thread itself.
extern "C" const char* __tsan_default_options() { return "report_signal_unsafe=0"; }

namespace {

// Signal tests run in forked children: the handler jumps, threads end and
// the process-wide record changes, none of which may touch the test process.

void say(const char* text) {
  fputs(text, stdout);
  fflush(stdout);
}

void action(uint64_t arg) { printf("action %d\n", static_cast<int>(arg)), fflush(stdout); }

// Raises SIGINT again after every return to its recovery point; the fourth
// return ends it. Resources 1, 2 before the first signal, 3 after it.
volatile int g_stage = 0;
void signalledBody(klpThread* t) {
  klpThread::prologue(t);
  if (KLP_SET_RECOVERY_POINT(t->rcvyMgr) != 0) {
    int rc = recoveryMgr::erRecover(&t->rcvyMgr, t);
    printf("return %d rc=%d signal=%d\n", t->rcvyMgr.recoveries, rc, t->rcvyMgr.signal);
    fflush(stdout);
  }
  if (g_stage == 0) {
    addRcvyRes(action, 1);
    addRcvyRes(action, 2);
  } else if (g_stage == 1) {
    addRcvyRes(action, 3);
  }
  g_stage = g_stage + 1;
  raise(SIGINT);
  say("not reached\n");
}

// Waits (state 7) with a recovery point that ends the thread. g_order only
// makes the stopper's message visibly come before ours (the logger has no
// lock of its own, and a signal is no ordering the race detector can see).
pthread_mutex_t g_order = PTHREAD_MUTEX_INITIALIZER;
void waitingBody(klpThread* t) {
  klpThread::prologue(t);
  if (KLP_SET_RECOVERY_POINT(t->rcvyMgr) != 0) {
    pthread_mutex_lock(&g_order);
    pthread_mutex_unlock(&g_order);
    threadEnd(t, recoveryMgr::erRecover(&t->rcvyMgr, t));
  }
  t->setState(KLP_THREAD_WAIT);
  for (int i = 0; i < 2000; ++i) hsvSleep(5);
  threadEnd(t, 0);
}

// Takes a fault with a recovery point set.
void faultingBody(klpThread* t) {
  klpThread::prologue(t);
  if (KLP_SET_RECOVERY_POINT(t->rcvyMgr) != 0) threadEnd(t, recoveryMgr::erRecover(&t->rcvyMgr, t));
  raise(SIGSEGV);
  threadEnd(t, 0);
}

void pointlessBody(klpThread* t) {
  klpThread::prologue(t);
  addRcvyRes(action, 7);  // still runs: nothing else would clean up
  raise(SIGINT);  // before any recovery point
  say("not reached\n");
}

// Takes the signal while it holds the thread-id list's lock, which the jump
// leaves held: the report at the recovery point must not need that lock.
void insideLockBody(klpThread* t) {
  klpThread::prologue(t);
  if (KLP_SET_RECOVERY_POINT(t->rcvyMgr) != 0) {
    int rc = recoveryMgr::erRecover(&t->rcvyMgr, t);
    say("reported\n");
    klpThreadIdList()->unlockList();
    threadEnd(t, rc);
  }
  klpThreadIdList()->lockList();
  raise(SIGINT);
  threadEnd(t, 0);
}

HSVHIPCQueue* g_queue = nullptr;
bool g_destroyQueue = true;
void queueBody(klpThread* t) {
  klpThread::prologue(t);
  // Registered on the thread that will be signalled, as its own resource.
  addRcvyRes(g_destroyQueue ? erHSVIPCQdestroy : erHSVIPCQdetach,
             reinterpret_cast<uint64_t>(&g_queue));
  if (KLP_SET_RECOVERY_POINT(t->rcvyMgr) != 0) {
    int rc = recoveryMgr::erRecover(&t->rcvyMgr, t);
    printf("queue pointer %s\n", g_queue ? "kept" : "cleared");
    threadEnd(t, rc);
  }
  raise(SIGINT);
  threadEnd(t, 0);
}

// Starts a thread with the given body in the child, waits for it and prints
// how it ended.
int runThread(klpThreadRoutine body, const char* name) {
  recoveryMgr::erReinstall();
  erClearGlobalSignal();
  OrdList list("Threads");
  list.makeShared(nullptr, 1);
  int code = -1;
  klpThread* t = createThread(&code, &list, body, name, nullptr, 1, nullptr, 0, 0);
  if (code != 0) return 90;
  void* ret = nullptr;
  pthread_join(t->handle, &ret);
  printf("end=%ld code=%d global=%d\n", static_cast<long>(reinterpret_cast<intptr_t>(ret)),
         t->getEndCode(), erGetGlobalSignal());
  return 0;
}

// A child with the main thread registered and a capturing logger; answers
// the child's standard output without the logger's lines.
struct SigRecovery : ::testing::Test {
  klpThread* mainThr = thrtest::mainReady();
  thrtest::LogCapture cap;
  std::string child(const std::function<int()>& body) {
    auto c = thrtest::inChild(cap.dir(), body);
    EXPECT_TRUE(c.exited) << c.out;
    EXPECT_EQ(0, c.exitCode);
    return thrtest::withoutMessages(c.out);
  }
};

bool endsWithMarker(const std::string& content) {
  static const std::string marker("***E**O**D**M***\0", 17);
  return content.size() >= marker.size() &&
         content.compare(content.size() - marker.size(), marker.size(), marker) == 0;
}

TEST_F(SigRecovery, ResourcesRunLastFirstOnceAndTheFourthReturnEndsTheThread) {
  EXPECT_EQ("action 2\n"
            "action 1\n"
            "return 1 rc=2009 signal=2\n"
            "return 2 rc=2010 signal=2\n"  // no resource ran: 3 stays registered
            "return 3 rc=2010 signal=2\n"
            "end=2010 code=2010 global=2\n",
            child([] { return runThread(signalledBody, "Signalled"); }));
  // Reported at each of the three returns; the fourth ends the thread first.
  EXPECT_EQ(3u, cap.issued(591).size());
  EXPECT_TRUE(cap.issuedWith(591, {"Signalled", "Handled", "SIGINT"})) << cap.log();
}

TEST_F(SigRecovery, ASignalOnAnUnregisteredThreadEndsItWith2009) {
#if defined(__SANITIZE_THREAD__)
  // Ending the thread unwinds out of the signal handler, through the race
  // detector's own signal frames, which cannot be unwound.
  GTEST_SKIP() << "not under ThreadSanitizer";
#endif
  EXPECT_EQ("end=2009\n", child([] {
              recoveryMgr::erReinstall();
              pthread_t raw;
              pthread_create(
                  &raw, nullptr,
                  [](void*) -> void* {
                    raise(SIGINT);
                    say("not reached\n");
                    return nullptr;
                  },
                  nullptr);
              void* ret = nullptr;
              pthread_join(raw, &ret);
              printf("end=%ld\n", static_cast<long>(reinterpret_cast<intptr_t>(ret)));
              return 0;
            }));
  EXPECT_TRUE(cap.issuedWith(591, {"Unknown", "Non-handled", "2"})) << cap.log();
  EXPECT_TRUE(cap.issuedWith(589, {"findRcvyMgr", "602", "findThread"})) << cap.log();
  EXPECT_TRUE(cap.issuedWith(589, {"signalHandler", "602", "findRcvyMgr"})) << cap.log();
}

TEST_F(SigRecovery, AFaultOnAThreadThatCannotRecoverTakesItsDefaultCourse) {
  // Leaving the process running after a fault on a thread nobody can bring
  // back would hide the damage: the fault ends the process as usual.
  auto c = thrtest::inChild(cap.dir(), [] {
    recoveryMgr::erReinstall();
    pthread_t raw;
    pthread_create(
        &raw, nullptr,
        [](void*) -> void* {
          raise(SIGSEGV);
          return nullptr;
        },
        nullptr);
    pthread_join(raw, nullptr);
    say("still running\n");
    return 0;
  });
  EXPECT_FALSE(c.exited) << c.out;
  EXPECT_EQ(SIGSEGV, c.signal);
  EXPECT_EQ(std::string::npos, c.out.find("still running"));
}

TEST_F(SigRecovery, ARegisteredThreadWithoutRecoveryPointEndsThroughThreadEnd) {
#if defined(__SANITIZE_THREAD__)
  GTEST_SKIP() << "not under ThreadSanitizer";  // see above
#endif
  // The end code is stored (and the state is 6) as for any other end.
  EXPECT_EQ("action 7\nend=2009 code=2009 global=2\n",
            child([] { return runThread(pointlessBody, "NoPoint"); }));
  EXPECT_TRUE(cap.issuedWith(591, {"Unknown", "Non-handled", "2"})) << cap.log();
}

TEST_F(SigRecovery, ASignalInsideTheThreadIdListLockIsStillReported) {
  EXPECT_EQ("reported\nend=2009 code=2009 global=2\n",
            child([] { return runThread(insideLockBody, "InLock"); }));
  EXPECT_TRUE(cap.issuedWith(591, {"InLock", "Handled", "SIGINT"})) << cap.log();
}

TEST_F(SigRecovery, StoppingAWaitingThreadSignalsItInsteadOfCuttingItOff) {
  EXPECT_EQ("end=2009 global=15\n", child([] {
              recoveryMgr::erReinstall();
              erClearGlobalSignal();
              OrdList list("Threads");
              list.makeShared(nullptr, 1);
              int code = -1;
              klpThread* t = createThread(&code, &list, waitingBody, "Waiter", nullptr, 1, nullptr, 0, 0);
              if (!thrtest::waitFor([&] { return t->getState() == KLP_THREAD_WAIT; })) return 91;
              pthread_mutex_lock(&g_order);
              int rc = klpThread::stop(t);
              pthread_mutex_unlock(&g_order);
              void* ret = reinterpret_cast<void*>(intptr_t{KLP_RC_RECOVERED});
              if (rc == KLP_RC_RECOVERED) pthread_join(t->handle, &ret);  // withdrawn: on its way out
              printf("end=%ld global=%d\n", static_cast<long>(reinterpret_cast<intptr_t>(ret)),
                     erGetGlobalSignal());
              return 0;
            }));
  EXPECT_TRUE(cap.issuedWith(591, {"Waiter", "Handled", "SIGTERM"})) << cap.log();
}

TEST_F(SigRecovery, QueueResourcesDestroyOrDetachTheirQueue) {
  std::string path = cap.dir() + "RCVY.TEST.IPC";
  for (bool destroy : {true, false}) {
    EXPECT_EQ("queue pointer cleared\nend=2009 code=2009 global=2\n", child([&] {
                HSVResID id;
                if (hsvIPCGetQueResID(path.c_str(), HSV_QUEUE_RESID_OPTION, &id) != 0) return 92;
                g_queue = new HSVHIPCQueue;
                if (g_queue->create(id, HSV_MAX_MSG_SIZE, HSV_CREATE_OPTION) != 0) return 93;
                g_destroyQueue = destroy;
                return runThread(queueBody, "QueueUser");
              }));
    EXPECT_EQ(!destroy, klptest::queueExists(path)) << (destroy ? "destroy" : "detach");
  }
  HSVResID id;  // leave nothing behind
  hsvIPCGetQueResID(path.c_str(), HSV_QUEUE_RESID_OPTION, &id);
  HSVHIPCQueue q;
  ASSERT_EQ(0u, q.attach(id));
  q.destroy();
  EXPECT_FALSE(klptest::queueExists(path));
  char ref[24];
  snprintf(ref, sizeof ref, "%016" PRIx64, reinterpret_cast<uint64_t>(&g_queue));
  EXPECT_TRUE(cap.issuedWith(595, {ref})) << cap.log();
  EXPECT_TRUE(cap.issuedWith(593, {ref})) << cap.log();
  EXPECT_TRUE(cap.has("<erHSVIPCQdestroy>")) << cap.log();
}

TEST_F(SigRecovery, AFaultWritesADumpAndIsReported) {
  std::string dir = cap.dir();
  EXPECT_EQ("end=2009 code=2009 global=0\n", child([&] {
              if (chdir(dir.c_str()) != 0) return 94;  // no dump directory set: the current one
              return runThread(faultingBody, "Faulty");
            }));
  std::string log = cap.log();
  EXPECT_TRUE(cap.issuedWith(569, {"SIGSEGV"})) << log;
  EXPECT_TRUE(cap.issuedWith(591, {"Faulty", "Handled", "SIGSEGV"})) << log;
  // No name prefix and no dump directory: "./.<pid>.<tid>.DUMP".
  int dumps = 0;
  for (const auto& entry : std::filesystem::directory_iterator(dir)) {
    std::string name = entry.path().filename().string();
    if (name.size() > 5 && name.compare(name.size() - 5, 5, ".DUMP") == 0) {
      ++dumps;
      EXPECT_EQ('.', name[0]) << name;
      EXPECT_TRUE(endsWithMarker(klptest::readFile(entry.path().string()))) << name;
      EXPECT_TRUE(cap.issuedWith(8053, {"SIGSEGV", "./" + name})) << log;
    }
  }
  EXPECT_EQ(1, dumps);
}

TEST(RecoveryDump, NamedDirPrefixPidTidAppendedAndEndingWithTheMarker) {
  thrtest::LogCapture cap;
  std::string dir = cap.dir().substr(0, cap.dir().size() - 1);
  std::string ids = "." + std::to_string(hsvProcessID()) + "." + std::to_string(hsvThreadID()) + ".DUMP";
  char path[1200];
  ASSERT_EQ(0, erDumpStackTraceTo(dir.c_str(), "S1", SIGSEGV, nullptr, nullptr, path, sizeof path));
  EXPECT_EQ(dir + "/S1" + ids, path);
  std::string first = klptest::readFile(path);
  EXPECT_TRUE(endsWithMarker(first));
  // A second dump of the same thread is appended.
  ASSERT_EQ(0, erDumpStackTraceTo(dir.c_str(), "S1", SIGSEGV, nullptr, nullptr));
  std::string both = klptest::readFile(path);
  EXPECT_GT(both.size(), first.size());
  EXPECT_EQ(0, both.compare(0, first.size(), first));
  EXPECT_TRUE(endsWithMarker(both));
  EXPECT_TRUE(cap.issuedWith(8053, {"SIGSEGV", path})) << cap.log();
  // A blank prefix is left out; a file that cannot be opened is 803.
  ASSERT_EQ(0, erDumpStackTraceTo(dir.c_str(), "   ", 8, nullptr, nullptr, path, sizeof path));
  EXPECT_EQ(dir + "/" + ids, path);
  EXPECT_EQ(KLP_RC_DUMP_FILE,
            erDumpStackTraceTo((dir + "/missing/dir").c_str(), "S1", 8, nullptr, nullptr));
  EXPECT_TRUE(cap.issuedWith(589, {"erDumpStackTraceInfo", "803", "HSVTrapFile::isValid"}))
      << cap.log();
  EXPECT_EQ(KLP_RC_DUMP_FILE,
            erDumpStackTraceTo(std::string(2000, 'd').c_str(), "S1", 8, nullptr, nullptr));
}

TEST(Recovery, ResourcesNeedARegisteredThreadAndCanBeDropped) {
  thrtest::mainReady();
  thrtest::LogCapture cap;
  int rc = 0;
  std::thread other([&] { rc = addRcvyRes(action, 0) == nullptr ? 1 : 0; });
  other.join();
  EXPECT_EQ(1, rc);
  EXPECT_TRUE(cap.issuedWith(589, {"addRcvyRes", "602", "findRcvyMgr"})) << cap.log();

  recoveryRes* r = addRcvyRes(action, 7);
  ASSERT_NE(nullptr, r);
  EXPECT_STREQ("KlpRcvyRes:", r->ole.eyeCatcher);
  EXPECT_EQ(&klpMainThread()->rcvyMgr.resList, r->ole.oleAnchor);
  EXPECT_GT(r->registered, 0);
  endRcvyRes(r);
  EXPECT_EQ(0, klpMainThread()->rcvyMgr.resList.count);
}

}  // namespace
