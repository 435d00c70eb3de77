// The trace utility against real processes: refusals, the sample server
// traced from its start and from the middle of its run, a lock left by a
// holder that died, and the exported entry point.
#include <dirent.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "common/platform/hsv.h"
#include "common/trace/trace_anchor.h"
#include "tests/e2e/e2e_support.h"

namespace {

constexpr int kStatus = 15, kStop = 14;

bool has(const std::string& text, const std::string& what) { return text.find(what) != std::string::npos; }

class Klptrc : public ::testing::Test {
 protected:
  klptest::TmpDir dir;
  const std::string srv = "TR1", block = dir.path() + "TR1.KLP.KCAP.TRC";

  // A trace a failed test left on is killed: no block or keeper outlives it.
  ~Klptrc() override { if (klptest::memoryExists(block)) trc({"kill"}); }
  // klptrc with args, then the keys of the test's server unless bare.
  klptest::ProcessResult trc(std::vector<std::string> args, bool bare = false) {
    args.insert(args.begin(), klptest::binPath("klptrc"));
    if (!bare) args.insert(args.end(), {"-db", srv, "-kcap"});
    return klptest::run(args, {}, 30000);
  }
  // A keeper process holding a block of this directory.
  bool keeperRunning() {
    bool found = false;
    if (DIR* d = opendir("/proc")) {
      while (dirent* e = readdir(d)) {
        std::string cmd = klptest::readFile(std::string("/proc/") + e->d_name + "/cmdline");
        std::replace(cmd.begin(), cmd.end(), '\0', ' ');
        found = found || (has(cmd, "klptrcbp") && has(cmd, dir.path()));
      }
      closedir(d);
    }
    return found;
  }
};

TEST_F(Klptrc, RefusalsWithoutATrace) {
  std::string missing = dir.path() + "missing.trc", foreign = dir.path() + "foreign.trc";
  std::string header(TRC_HEADER_SIZE, '\0');
  header.replace(0, 7, "Windows").replace(16, 4, "0012").replace(24, 4, "0024");
  header[32] = 54, header[34] = static_cast<char>(250);
  std::ofstream(foreign, std::ios::binary) << header;
  const std::vector<std::vector<std::string>> cases = {
      {"onx", "-db", "A", "-kcap"}, {"on"}, {"stat"}, {"json", "fmt", "-fn", missing},
      {"stat", "-db", "A", "-kcap"}, {"resetlock", "-db", "A", "-kcap"},
      {"off", "-db", "A", "-kcap"}, {"kill", "-db", "A", "-kcap"}, {"stat", "-fn", missing},
      {"FMT", "-fn", missing}, {"stat", "-fn", foreign}};
  std::string said;
  for (const std::vector<std::string>& args : cases) {
    klptest::ProcessResult r = trc(args, true);
    EXPECT_EQ(r.exitCode, 0);
    said += "$";
    for (const std::string& a : args) said += " " + a;
    said += "\n" + r.out;
  }
  for (size_t at; (at = said.find(dir.path())) != std::string::npos;)
    said.replace(at, dir.path().size(), "DIR/");
  EXPECT_EQ(said, klptest::readFile(KLP_SOURCE_DIR "/tests/e2e/klptrc_refusals.golden"));

  std::string help = trc({"-help"}, true).out;
  EXPECT_EQ(help.substr(0, help.find('\n') + 1),
            "klptrc  8.1.0 (platform: Linux; format: 0012/0024)\n");
  EXPECT_TRUE(has(klptest::lines(help).back(), "klptrc json [-fn file | <keys>] [-ofn outfile]"));
  // 54 components; rows that name no trace point are left out.
  EXPECT_EQ(trc({"-listsymbols"}, true).out, klptest::readFile(KLP_SOURCE_DIR "/tests/e2e/klptrc_symbols.golden"));
  // -ofn appends to its file.
  std::string outFile = dir.path() + "out.txt";
  std::ofstream(outFile) << "before\n";
  EXPECT_EQ(trc({"-help", "-ofn", outFile}, true).out, "");
  EXPECT_EQ(klptest::readFile(outFile), "before\n" + help);

  HSVSharedLib lib;  // the entry point is exported with C linkage
  ASSERT_EQ(lib.load((std::string(KLP_BIN_DIR) + "/../lib/libklp.so").c_str(), 0), ECF_OK)
      << lib.lastError();
  EXPECT_NE(lib.getFuncAddress("_klpTrace"), nullptr);
}

TEST_F(Klptrc, ServerTracedFromItsStart) {
  klptest::ProcessResult on = trc({"on", "-d", "1,2,3"});
  ASSERT_TRUE(has(on.out, "Trace is turned on, with IPC key '(shm, /klpm.")) << on.out;
  EXPECT_TRUE(has(trc({"on"}).out, "Trace is already on, no action taken.\n"));
  EXPECT_TRUE(keeperRunning());
  e2e::Server s(dir, srv);
  ASSERT_TRUE(s.ready());
  e2e::RawClient c(s.queue());
  ASSERT_TRUE(c.ok());
  e2e::Reply r;
  ASSERT_TRUE(c.ask(kStatus, &r));

  std::string stat = trc({"statlong"}).out;
  EXPECT_TRUE(has(stat, "Trace status from buffer with IPC key '(shm, /klpm.")) << stat;
  EXPECT_TRUE(has(stat, "LogDiagLvl : 1,2,3\nStatus:      Running\n")) << stat;
  EXPECT_TRUE(has(stat, "  Unique Name:       TR1.KLP.KCAP\n")) << stat;
  EXPECT_TRUE(has(stat, "Module-level version information:\n  name           apar      compiled\n"));
  std::string flow = trc({"flw"}).out;
  EXPECT_GE(e2e::countOf(flow, "\npid = "), 2u) << flow;  // records of two threads at least
  EXPECT_TRUE(has(flow, " thr = AdminThread\n")) << flow;   // the threads are named
  EXPECT_TRUE(has(flow, " thr = Initial\n")) << flow;
  EXPECT_TRUE(has(flow, "| cmdsHandleMessage fnc_data \"Got IPC Message\" lvl 3\n")) << flow;

  // A trace file is read under the name it is given, not the one it was
  // written under.
  std::string dump = dir.path() + "dump.trc", moved = dir.path() + "moved.trc";
  EXPECT_EQ(trc({"dmp", dump}).out, "");
  ASSERT_EQ(rename(dump.c_str(), moved.c_str()), 0);
  std::string full = trc({"fmt", "-fn", moved}, true).out;
  EXPECT_TRUE(has(full, "cmdsHandleMessage fnc_data \"Got IPC Message\" lvl 3\n"
                        "         Object 1 of type \"Raw binary data\": (hex dump)\n")) << full;
  EXPECT_TRUE(has(trc({"stat", "-fn", moved}, true).out, "LogDiagLvl : N/A\nStatus:      N/A\n"));
  std::string json = trc({"json", "-fn", moved, "-d", "1"}, true).out;
  EXPECT_EQ(json.substr(0, 39), "{\"displayTimeUnit\":\"ms\",\"traceEvents\":[");
  EXPECT_EQ(json.substr(json.size() - 4), "\n]}\n");
  EXPECT_TRUE(has(json, "{\"name\":\"cmdsHandleMessage\",\"cat\":\"Capture/Apply Common Function\","
                        "\"ph\":\"B\""));
  EXPECT_FALSE(has(json, "\"ph\":\"i\""));  // level 1 only: no data records

  // Filters change while the trace runs; diag shows them.
  trc({"-d", "2", "-df", "cmdsEngine", "1", "-df", "Capture Prune", "4"});
  EXPECT_EQ(trc({"diag"}).out,
            "\nDiag Settings\n=============\nGlobal filter = 2\n"
            "Component: \"Capture Prune\" = 4\n"
            "Component: \"Capture/Apply Common Function\"\n Function: \"cmdsEngine\" = 1\n\n");
  EXPECT_EQ(trc({"clr"}).exitCode, 0);
  EXPECT_TRUE(has(trc({"stat"}).out, "Num Entries: 0\n"));

  // The command program traces into the block and leaves the server's hold
  // on it, and its description, alone.
  auto status = [&] {
    return klptest::run({klptest::binPath("klpkccmd"), "CAPTURE_SERVER=" + srv, "STATUS"});
  };
  ASSERT_EQ(status().exitCode, 0);
  EXPECT_TRUE(has(trc({"stat"}).out, "Replication version info:\n  klpkcap 9.7.8\n"));

  // Off while the server holds the block leaves the freeing to it.
  EXPECT_EQ(trc({"off"}).out,
            "Trace is turned off.\nUnable to free the trace buffer at this time.\nThe \"KCAP\" "
            "application will free the trace buffer while it is running or when it is "
            "restarted.\nUse the klptrc \"kill\" option to free the trace buffer, if the \"KCAP\" "
            "application is stopped.\n");
  ASSERT_EQ(status().exitCode, 0);  // finds the block turned off
  EXPECT_TRUE(klptest::memoryExists(block));
  EXPECT_TRUE(e2e::waitFor([&] { return !keeperRunning(); }, 10000));
  ASSERT_TRUE(c.ask(kStop, &r));
  EXPECT_EQ(s.proc().wait(30000).exitCode, 0);
  EXPECT_FALSE(klptest::memoryExists(block));
}

TEST_F(Klptrc, TurnedOnForARunningServerThenKilled) {
  e2e::Server s(dir, srv);
  ASSERT_TRUE(s.ready());
  ASSERT_TRUE(has(trc({"on"}).out, "Trace is turned on"));
  // The notice reaches the server before the command does.
  e2e::RawClient c(s.queue());
  ASSERT_TRUE(c.ok());
  e2e::Reply r;
  ASSERT_TRUE(c.ask(kStatus, &r));
  EXPECT_TRUE(has(trc({"fmt"}).out, "cmdsHandleMessage fnc_entry at time"));
  EXPECT_EQ(trc({"kill"}).out, "Forcing trace off...\n");
  EXPECT_FALSE(klptest::memoryExists(block));
  EXPECT_TRUE(e2e::waitFor([&] { return !keeperRunning(); }, 10000));
  ASSERT_TRUE(c.ask(kStop, &r));
  EXPECT_EQ(s.proc().wait(30000).exitCode, 0);
}

// Turned on by a copy of the program with no keeper beside it or on PATH.
TEST_F(Klptrc, ResetlockFreesALockItsHolderLeft) {
  std::string lone = dir.path() + "klptrc";
  std::filesystem::copy_file(klptest::binPath("klptrc"), lone);
  klptest::ProcessResult on = klptest::run({lone, "on", "-db", srv, "-kcap"}, {"PATH=/nonexistent"});
  ASSERT_TRUE(has(on.out, "Trace is turned on") && has(on.out, "Create Process failed!!\n")) << on.out;
  HSVHIPCMemory* m = nullptr;
  trcBlockHeader* b = nullptr;
  klptest::Child holder = klptest::inChild(dir.path(), [&] {
    if (trcOpenBlock(dir.path().c_str(), (srv + ".KLP.KCAP").c_str(), &m, &b) != ECF_OK) return 1;
    trcLockBuffer(b);
    return 0;  // ends holding the lock
  });
  ASSERT_EQ(holder.exitCode, 0);
  ASSERT_EQ(trcOpenBlock(dir.path().c_str(), (srv + ".KLP.KCAP").c_str(), &m, &b), ECF_OK);
  EXPECT_EQ(b->bufferLock, 1);
  EXPECT_EQ(trc({"resetlock"}).out, "");
  EXPECT_EQ(b->bufferLock, 0);
  EXPECT_EQ(trc({"clr"}).exitCode, 0);  // does not wait
  m->detach();
  delete m;
  EXPECT_EQ(trc({"off"}).out, "Trace is turned off.\n");
  EXPECT_FALSE(klptest::memoryExists(block));
  EXPECT_TRUE(e2e::waitFor([&] { return !keeperRunning(); }, 10000));
}

// Turned off (by this process's own block calls) while the server writes,
// or off and on again before the server let go: it frees only its block.
TEST_F(Klptrc, TurnedOffUnderTheServerOrOnAgain) {
  const std::string key = srv + ".KLP.KCAP";
  trcInitAnchor();
  for (bool onAgain : {false, true}) {
    SCOPED_TRACE(onAgain);
    auto turnOn = [&] {
      ASSERT_EQ(0, trcCreate(TRC_MIN_SIZE * 4, dir.path().c_str(), key.c_str(), nullptr,
                             TRC_MAX_SIZE, 0x3F, true));
    };
    e2e::Server server(dir, srv);
    ASSERT_TRUE(server.ready());
    turnOn();
    ASSERT_EQ(0, _trcSendIPCMsg(dir.path().c_str(), key.c_str(), 10));
    trcBlockHeader* b = trcGetAnchor()->block;
    ASSERT_TRUE(e2e::waitFor([&] { return b->appAttached == TRC_APP_ATTACHED; }, 20000));
    EXPECT_STREQ("klpkcap", b->appVersion.rel.programName);
    EXPECT_NE(0, b->moduleCount);
    trcLockBuffer(b);
    b->status = TRC_STATE_STOP;
    trcUnlockBuffer(b);
    if (onAgain) {
      turnOn();  // removes the old block's name and makes a new block under it
    } else {
      trcDropBlock(false);  // the server is attached: freeing is its part
      EXPECT_TRUE(klptest::memoryExists(block));
    }
    server.proc().kill(SIGTERM);
    EXPECT_EQ(0, server.proc().wait(20000).exitCode);
    EXPECT_EQ(onAgain, klptest::memoryExists(block));
    if (onAgain) trcFree();
  }
}

}  // namespace
