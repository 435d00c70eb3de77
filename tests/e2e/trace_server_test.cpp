// The sample server traced live: a trace turned on before it starts, or
// while it runs (the trace-on notice), then turned off or killed; no
// shared block is left once the server has ended.
#include <cstring>
#include <functional>
#include <set>
#include <string>

#include "common/trace/trace_anchor.h"
#include "common/trace/trcread.h"
#include "tests/e2e/e2e_support.h"

namespace {

// Process ids of the records now held.
std::set<int32_t> writers(trcBlockHeader* b) {
  std::set<int32_t> pids;
  trcIter it;
  trcIterInit(&it, b, b->bufferSize, false);
  trcLockBuffer(b);
  while (trcNextRecord(&it)) pids.insert(it.record->pid);
  trcUnlockBuffer(b);
  return pids;
}

TEST(TraceServer, TracedLiveThenTurnedOffOrKilled) {
  struct Row {
    const char* what;
    bool onBeforeStart;
    bool kill;     // force off and free at once; otherwise off, freed by the server
    bool onAgain;  // after off, on again before the server let go of the old block
  };
  for (const Row& row : {Row{"on before start, off", true, false, false},
                         Row{"on while running, off", false, false, false},
                         Row{"on while running, kill", false, true, false},
                         Row{"off, then on again", false, false, true}}) {
    SCOPED_TRACE(row.what);
    klptest::TmpDir dir;
    const std::string key = "TRCE2E.KLP.KCAP", block = dir.path() + key + ".TRC";
    trcInitAnchor();
    auto turnOn = [&] {
      ASSERT_EQ(0, trcCreate(TRC_MIN_SIZE * 4, dir.path().c_str(), key.c_str(), nullptr,
                             TRC_MAX_SIZE, 0x3F, true));
    };
    if (row.onBeforeStart) turnOn();
    e2e::Server server(dir, "TRCE2E");
    ASSERT_TRUE(server.ready());
    if (!row.onBeforeStart) {
      turnOn();
      ASSERT_EQ(0, _trcSendIPCMsg(dir.path().c_str(), key.c_str(), 10));
    }
    trcBlockHeader* b = trcGetAnchor()->block;
    ASSERT_TRUE(e2e::waitFor([&] { return writers(b).count(server.pid()) == 1; }, 20000));
    EXPECT_EQ(TRC_APP_ATTACHED, b->appAttached);
    EXPECT_STREQ("klpkcap", b->appVersion.rel.programName);
    EXPECT_NE(0, b->moduleCount);

    trcLockBuffer(b);
    b->status = TRC_STATE_STOP;
    trcUnlockBuffer(b);
    if (row.kill) {
      trcFree();  // the name goes; the server keeps its mapping until it ends
      EXPECT_FALSE(klptest::memoryExists(block));
    } else if (row.onAgain) {
      turnOn();  // removes the old block's name and makes a new block under it
    } else {
      trcDropBlock(false);  // the server is attached: freeing is its part
      EXPECT_TRUE(klptest::memoryExists(block));
    }
    server.proc().kill(SIGTERM);
    EXPECT_EQ(0, server.proc().wait(20000).exitCode);
    // The server removed only the block it held.
    EXPECT_EQ(row.onAgain, klptest::memoryExists(block));
    if (row.onAgain) trcFree();
  }
}

}  // namespace
