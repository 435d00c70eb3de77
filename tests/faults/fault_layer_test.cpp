// The fault-injecting layer: its texts, its allocator, and the loaders' points the walk cannot reach.
#include <cerrno>
#include <new>
#include <cstdio>

#include "common/db/klpdll.h"
#include "common/db/oradl.h"
#include "common/msg/msglogger.h"
#include "common/platform/hsv_fault.h"
#include "tests/e2e/e2e_support.h"

namespace {

struct Disarm {
  ~Disarm() { hsvFaultArm(nullptr); }
};

// Four resource-id lookups under a text: '.' success, 'F' the operation's code, 'L' ECF_LIMIT_REACHED.
std::string lookups(const std::string& spec) {
  if (!hsvFaultArm(spec.c_str())) return "refused";
  std::string seen;
  for (int i = 0; i < 4; ++i) {
    HSVResID id;
    hsvRC rc = hsvIPCGetQueResID("/tmp/X.IPC", HSV_QUEUE_RESID_OPTION, &id);
    seen += rc == ECF_OK                 ? '.'
            : rc == ECF_INVALID_ARGUMENT ? 'F'
            : rc == ECF_LIMIT_REACHED    ? 'L'
                                         : '?';
  }
  return seen;
}

}  // namespace

TEST(FaultLayer, TextsChooseTheUsesThatFail) {
  if (!hsvFaultCompiledIn()) GTEST_SKIP() << "built without KLP_FAULTS";
  Disarm disarm;
  const std::string self = program_invocation_short_name;
  const struct {
    std::string spec, seen;
  } cases[] = {
      {"", "...."}, {"resid.queue:2", ".F.."}, {"resid.queue:2-3", ".FF."}, {"resid.queue:3+", "..FF"},
      {"resid.queue:1,resid.queue:4=0x9000000C", "F..L"}, {"resid.memory:1", "...."}, {self + "/resid.queue:1", "F..."},
      {"klpkcap/resid.queue:1,wait=3,klpkcap/log=/nonexistent/dir/x", "...."}, {"resid.queue", "refused"},
      {"resid.queue:0", "refused"}, {"resid.queue:3-2", "refused"}, {"resid.queue:1=0", "refused"},
      {"resid.queue:x", "refused"}, {"queue.putt:1", "refused"}, {"sleep=0", "refused"},
      {"log=/nonexistent/dir/x", "refused"},
  };

  for (const auto& c : cases) EXPECT_EQ(lookups(c.spec), c.seen) << c.spec;

  klptest::TmpDir dir;
  ASSERT_TRUE(hsvFaultArm(("resid.queue:2,log=" + dir.path() + "uses").c_str()));
  EXPECT_EQ(lookups(""), "....");  // re-arming sets the counts back
  ASSERT_TRUE(hsvFaultArm(("resid.queue:2,log=" + dir.path() + "uses").c_str()));
  HSVResID id;
  hsvIPCGetQueResID("/tmp/X.IPC", HSV_QUEUE_RESID_OPTION, &id);
  hsvIPCGetQueResID("/tmp/X.IPC", HSV_QUEUE_RESID_OPTION, &id);
  EXPECT_EQ(hsvFaultUses(HSV_FAULT_RESID_QUEUE), 2u);
  std::string pid = std::to_string(getpid());
  EXPECT_EQ(klptest::readFile(dir.path() + "uses"),
            self + " " + pid + " resid.queue 1\n" + self + " " + pid + " resid.queue 2 fails\n");
}

TEST(FaultLayer, PlatformObjectsComeFromAnAllocatorThatCanFail) {
  if (!hsvFaultCompiledIn()) GTEST_SKIP() << "built without KLP_FAULTS";
  Disarm disarm;
  ASSERT_TRUE(hsvFaultArm("alloc:1-2"));
  EXPECT_EQ(new (std::nothrow) HSVHIPCQueue, nullptr);
  EXPECT_THROW(delete new HSVHIPCMemory, std::bad_alloc);
  HSVHIPCWaitpost* w = new (std::nothrow) HSVHIPCWaitpost;
  ASSERT_NE(w, nullptr);
  EXPECT_EQ(w->create(HSV_CREATE_OPTION), ECF_OK);  // its state is the fourth
  delete w;
  EXPECT_EQ(hsvFaultUses(HSV_FAULT_ALLOC), 4u);
}

// The loaders under a failing load, lookup or allocation, each in a child: their state is process-wide.
TEST(FaultLayer, LibraryLoadersReportTheirFailures) {
  if (!hsvFaultCompiledIn()) GTEST_SKIP() << "built without KLP_FAULTS";
  const struct {
    const char* spec;
    bool oci;  // the OCI loader; else a descriptor of two functions
    int rc;
    std::vector<const char*> texts;
  } cases[] = {
      {"lib.load:1", false, KLPDLL_RC_NOT_LOADED, {"KLP0616E", "0x90000002", "libm.so.6"}},
      {"lib.getFuncAddress:2", false, 0, {"KLP0606I", "KLP0617E", "\"sin\" was not found"}},
      {"lib.load:1", true, 0, {"KLP0657E", "\"0x90000002\""}},
      {"lib.getFuncAddress:1", true, 0, {"KLP0658I", "KLP0659E", "\"OCIHandleAlloc\""}},
      // The OCI library object needs no allocation that could end the caller.
      {"alloc:1+", true, 0, {"KLP0658I", "KLP0659E"}},
  };
  for (const auto& c : cases) {
    klptest::TmpDir dir;
    klptest::Child child = klptest::inChild(dir.path(), [&] {
      klptest::ProcessLogger logger(MSG_APP_KLPKCCMD, dir.path(), "lib.log");
      if (!hsvFaultArm(c.spec)) return 99;
      if (c.oci) {
        ORADL::setLibraryName("libm.so.6");
        return ORADL::OCIInit();
      }
      const klpDLLCandidate libm[] = {{"libm.so.6", ""}};
      klpDLLFunc funcs[] = {{"cos", nullptr}, {"sin", nullptr}};
      klpDLL dll("ODB_DLL", libm, 1, funcs, 2);
      return klpdll::loadLib(&dll);
    });
    EXPECT_TRUE(child.exited) << c.spec << " signal " << child.signal << "\n" << child.err;
    EXPECT_EQ(child.exitCode, c.rc % 256) << c.spec;
    std::string log = klptest::readFile(dir.path() + "lib.log");
    for (const char* t : c.texts)
      EXPECT_NE(log.find(t), std::string::npos) << c.spec << ": " << t << "\n" << log;
  }
}

// A server whose every get fails must pause between passes, not spin a core.
TEST(FaultLayer, AServerWhoseGetsFailDoesNotSpin) {
  if (!hsvFaultCompiledIn()) GTEST_SKIP() << "built without KLP_FAULTS";
  klptest::TmpDir dir;
  e2e::Server server(dir, "GF", {}, {"KLP_TEST_FAULTS=klpkcap/queue.get:1+"});
  ASSERT_TRUE(server.ready());
  ASSERT_TRUE(e2e::RawClient(server.queue(), false).sendBytes(e2e::RawClient::request(15)));
  auto cpuTicks = [&] {  // utime and stime, the 14th and 15th fields
    std::string stat = klptest::readFile("/proc/" + std::to_string(server.pid()) + "/stat");
    long utime = 0, stime = 0;
    EXPECT_EQ(sscanf(stat.c_str() + stat.rfind(')') + 2, "%*s %*s %*s %*s %*s %*s %*s %*s %*s %*s %*s %ld %ld",
                     &utime, &stime), 2) << stat;
    return utime + stime;
  };
  long before = cpuTicks();
  sleep(2);
  long used = cpuTicks() - before;  // a spinning loop takes about 200 ticks here
  EXPECT_LT(used, 50) << "ticks of CPU in 2 s";
}
