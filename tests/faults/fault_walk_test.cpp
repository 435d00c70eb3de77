// Every failure point (each use of each platform call, found by a counting run) of STATUS, CHGPARMS,
// klptrc on/fmt/off, a server's start and stop: its texts and exits; no crash, hang or leftover.
#include <sys/stat.h>

#include <cstdio>
#include <fstream>
#include <set>
#include <sstream>

#include "common/platform/hsv_fault.h"
#include "tests/e2e/e2e_support.h"

namespace {

const std::string kServer = "FW";
constexpr int kNotRun = -2;  // the step needs a server that never came up
constexpr int kStepLimitMs = 20000;

struct Scenario {
  const char* name;
  std::vector<std::vector<std::string>> before;  // unarmed, once the server is up
  std::vector<std::string> step;                 // the command a point is walked under
  std::vector<std::vector<std::string>> after;   // unarmed
  bool serverFromStart;  // the server's points count from its start, not from the step
  const char* done;      // what the step shows when the failure did not stop it
};
void PrintTo(const Scenario& s, std::ostream* os) { *os << s.name; }  // in test listings

const std::vector<std::string> kTrcKill = {"klptrc", "kill"};
const std::vector<std::string> kTrcOn = {"klptrc", "on"};
const Scenario kScenarios[] = {
    {"STATUS", {}, {"klpkccmd", "STATUS"}, {}, false, "KLP0520I"},
    {"CHGPARMS", {}, {"klpkccmd", "CHGPARMS", "COMMIT_INTERVAL=900"}, {}, false, "KLP0523I"},
    {"TraceOn", {}, kTrcOn, {kTrcKill}, false, "Trace is turned on, with IPC key"},
    {"TraceFmt", {kTrcOn}, {"klptrc", "fmt"}, {kTrcKill}, false, "Trace Version: "},
    {"TraceOff", {kTrcOn}, {"klptrc", "off"}, {kTrcKill}, false, "Trace is turned off.\n"},
    {"ServerStartStop", {}, {"klpkccmd", "STOP"}, {}, true, "KLP0595I"},
};

// Points (KLP_TEST_FAULTS texts: "program/operation:use" and knobs) with one outcome; the texts are
// looked for in the step's output and the server's log ("!": must be absent; kDone: the scenario's own).
struct Row {
  const char* scenarios;
  std::vector<const char*> points;
  int stepExit, serverExit;
  std::vector<const char*> texts;
};

const char* const kDone = "";
const char* const kAttach = "Function 'HSVHIPCMemory::attach' with IPC key '(shm, /klpm.";

// clang-format off
const Row kRows[] = {
    // The command program needs not its logger's queue, its trace attach nor one attach
    // attempt of five; everything else ends it with 12 and 589 naming KLPCmdFunc.
    {"STATUS CHGPARMS", {"klpkccmd/waitpost.create:1", "klpkccmd/alloc:1"}, 0, 0,
         {"unknown wait/post create error\n", kDone}},
    {"STATUS CHGPARMS", {"klpkccmd/resid.memory:1", "klpkccmd/alloc:2", "klpkccmd/memory.attach:1",
         "klpkccmd/resid.queue:1", "klpkccmd/queue.attach:1", "klpkccmd/queue.hasMessage:1",
         "klpkccmd/queue.waitForMessage:1"}, 0, 0, {kDone}},
    {"STATUS CHGPARMS", {"klpkccmd/queue.attach:1+"}, 12, 0, {"KLP0506E", "KLP0597E", "\"815\": \"KLPCmdFunc\""}},
    {"STATUS CHGPARMS", {"klpkccmd/alloc:3", "klpkccmd/alloc:4"}, 12, 0, {"\"1003\": \"KLPCmdFunc\""}},
    {"STATUS CHGPARMS", {"klpkccmd/resid.queue:2", "klpkccmd/queue.create:1"}, 12, 0,
         {"KLP0596E", "KLP0507E", "\"804\": \"KLPCmdFunc\""}},
    {"STATUS CHGPARMS", {"klpkccmd/queue.put:1"}, 12, 0, {"KLP0508E", "KLP0601E", "\"805\": \"KLPCmdFunc\""}},
    {"STATUS CHGPARMS", {"klpkccmd/queue.get:1"}, 12, 0, {"KLP0510E", "KLP0602E", "\"824\": \"KLPCmdFunc\""}},
    {"STATUS CHGPARMS", {"klpkccmd/queue.get:1=0x90000008"}, 12, 0,
         {"KLP0525E", "KLP0602E", "\"816\": \"KLPCmdFunc\""}},
    // The server reports a failed get and takes the request on the next pass; a reply it
    // cannot deliver is reported and dropped, and the command program gives up (824).
    {"STATUS CHGPARMS", {"klpkcap/queue.get:1"}, 0, 0,
         {"KLP0525E", "\"816\": \"HSVHIPCQueue::get\"", "KLP0517I", kDone}},
    {"STATUS CHGPARMS", {"klpkcap/resid.queue:2,klpkccmd/wait=40", "klpkcap/queue.attach:2,klpkccmd/wait=40"}, 12, 0,
         {"KLP0597E", "KLP0506E", "KLP0510E", "\"824\": \"KLPCmdFunc\""}},
    {"STATUS CHGPARMS", {"klpkcap/queue.put:1,klpkccmd/wait=40"}, 12, 0,
         {"KLP0508E", "\"805\": \"HSVHIPCQueue::put\"", "KLP0510E"}},
    // The trace command: a block it cannot look at ends it; the trace goes on when only
    // the keeper or the notice to the server fails.
    {"TraceOn TraceFmt TraceOff", {"klptrc/resid.memory:1", "klptrc/alloc:1", "klptrc/memory.attach:1"}, 0, 0,
         {kAttach, "!Trace is "}},
    {"TraceOn", {"klptrc/resid.memory:2"}, 0, 0,
         {"Function 'hsvIPCGetResID' for path '/tmp/", "Trace failed to start with return code 3000.\n"}},
    {"TraceOn", {"klptrc/alloc:2"}, 0, 0, {"Function 'HSVHIPCMemory::create' with IPC key '(shm, /klpm.",
         "Trace failed to start with return code 1003.\n"}},
    {"TraceOn", {"klptrc/memory.create:1"}, 0, 0, {"Function 'HSVHIPCMemory::create' with IPC key '(shm, /klpm.",
         "Trace failed to start with return code 3000.\nKey token was 'FW.KLP.KCAP'\n"}},
    {"TraceOn", {"klptrc/resid.memory:3"}, 0, 0, {"Trace is turned on, but an error occurred retrieving IPC key.\n"}},
    {"TraceOn", {"klptrc/process.start:1", "klptrc/process.wait:1", "klptrcbp/process.start:1"}, 0, 0,
         {kDone, "Create Process failed!!\n"}},
    {"TraceOn", {"klptrc/resid.queue:1", "klptrc/queue.attach:1"}, 0, 0, {kDone}},
    {"TraceOn", {"klptrc/queue.put:1"}, 0, 0,
         {kDone, "Function '_trcSendIPCMsg' call to 'HSVHIPCQueue::put' for path '/tmp/"}},
    // The server told of the trace: untraced when it cannot attach.
    {"TraceOn", {"klpkcap/queue.get:1"}, 0, 0, {kDone, "KLP0525E", "KLP0517I"}},
    {"TraceOn", {"klpkcap/resid.memory:2", "klpkcap/alloc:4", "klpkcap/memory.attach:2"}, 0, 0, {kDone}},
    // The server starts without its logger's queue, its trace attach or the look for an
    // earlier run's queue; without its own queue it ends with 12 and says why.
    {"ServerStartStop", {"klpkcap/waitpost.create:1", "klpkcap/alloc:1"}, 0, 0,
         {"unknown wait/post create error\n", kDone}},
    {"ServerStartStop", {"klpkcap/resid.memory:1", "klpkcap/alloc:2", "klpkcap/memory.attach:1",
         "klpkcap/queue.attach:1", "klpkcap/queue.hasMessage:1", "klpkcap/queue.waitForMessage:1"}, 0, 0, {kDone}},
    {"ServerStartStop", {"klpkcap/alloc:3"}, kNotRun, 12, {"\"1003\": \"setEnvIpcQRcvHdl\""}},
    {"ServerStartStop", {"klpkcap/resid.queue:1", "klpkcap/queue.create:1"}, kNotRun, 12,
         {"KLP0596E", "KLP0507E", "\"804\": \"setEnvIpcQRcvHdl\""}},
    // Its stop: the stop goes on when the answer cannot.
    {"ServerStartStop", {"klpkcap/queue.get:1"}, 0, 0, {"KLP0525E", "KLP0517I", kDone}},
    {"ServerStartStop", {"klpkcap/resid.queue:2,klpkccmd/wait=40", "klpkcap/queue.attach:2,klpkccmd/wait=40"}, 12, 0,
         {"KLP0597E", "KLP0506E", kDone}},
    {"ServerStartStop", {"klpkcap/queue.put:1,klpkccmd/wait=40"}, 12, 0,
         {"KLP0508E", "\"805\": \"HSVHIPCQueue::put\"", kDone}},
};
// clang-format on

// Uses that follow the clock, as the keeper's second process does, need not be reached.
bool counts(const std::string& program, const std::string& op) {
  return program != "klptrcbp" && op != "queue.hasMessage" && op != "queue.waitForMessage" && op != "waitpost.wait";
}

// The failure items of a point ("program/operation:use", knobs left out), and whether each counts.
std::vector<std::pair<std::string, bool>> failures(const std::string& point) {
  std::vector<std::pair<std::string, bool>> out;
  std::stringstream ss(point);
  char program[32], op[64];
  int use = 0;
  for (std::string it; std::getline(ss, it, ',');)
    if (sscanf(it.c_str(), "%31[a-z]/%63[a-zA-Z.]:%d", program, op, &use) == 3)
      out.emplace_back(std::string(program) + "/" + op + ":" + std::to_string(use), counts(program, op));
  return out;
}

// Uses logged ("<program> <pid> <operation> <use>[ fails]"): a counting run's points (between the marks,
// or the server's from its start), or else those that failed.
std::set<std::string> usesIn(const std::string& log, const Scenario* counting) {
  std::set<std::string> out;
  bool inStep = false;
  for (const std::string& line : klptest::lines(log)) {
    if (line.rfind("mark ", 0) == 0) inStep = line == "mark step";
    std::stringstream ss(line);
    std::string program, pid, op, use, tail;
    if (!(ss >> program >> pid >> op >> use)) continue;
    bool fails = static_cast<bool>(ss >> tail) && tail == "fails";
    if (!counting ? fails
                  : counts(program, op) && (counting->serverFromStart ? program == "klpkcap" : inStep))
      out.insert(program + "/" + op + ":" + use);
  }
  return out;
}

std::vector<std::string> argvOf(const std::vector<std::string>& cmd) {
  std::vector<std::string> argv = {klptest::binPath(cmd[0])};
  if (cmd[0] == "klpkccmd") argv.push_back("CAPTURE_SERVER=" + kServer);
  argv.insert(argv.end(), cmd.begin() + 1, cmd.end());
  if (cmd[0] == "klptrc") argv.insert(argv.end(), {"-db", kServer, "-kcap"});
  return argv;
}

// The run's directory, and the fault text for every process of the run.
std::vector<std::string> envOf(const klptest::TmpDir& dir, const std::string& spec) {
  return {"TMPDIR=" + dir.path(), "KLP_TEST_FAULTS=" + spec};
}

struct Outcome {
  int stepExit = kNotRun, serverExit = kNotRun;
  std::string output;               // the step's and the server's
  std::vector<std::string> faults;  // crashes, hangs and leftovers
  std::string log;                  // the uses
  void took(const klptest::ProcessResult& r, const std::string& who) {
    if (r.timedOut || r.signal != 0)
      faults.push_back(who + (r.timedOut ? " did not end" : " ended by signal " + std::to_string(r.signal)));
  }
};

std::unique_ptr<e2e::Server> startServer(const klptest::TmpDir& dir, const std::string& spec) {
  return std::make_unique<e2e::Server>(dir, kServer, std::vector<std::string>{}, envOf(dir, spec));
}

// Asks the server to stop (unless asked already or ended) and takes its end.
void stopServer(e2e::Server& server, const klptest::TmpDir& dir, Outcome* o, std::vector<int>* clientPids,
                bool ask = true) {
  if (ask && server.proc().running()) {
    klptest::Background stop(argvOf({"klpkccmd", "STOP"}), envOf(dir, ""));
    stop.wait(kStepLimitMs);
    clientPids->push_back(stop.pid());
  }
  klptest::ProcessResult r = server.proc().wait(30000);
  o->serverExit = r.exitCode;
  o->took(r, "the server");
  o->output += r.out + r.err + server.log();
}

// A shared-memory object of the path, sized or not, is still named.
bool memoryLeft(const std::string& path) {
  HSVResID id;
  struct stat st;
  return hsvIPCGetResID(path.c_str(), HSV_MEMORY_RESID_OPTION, &id) == ECF_OK &&
         stat((std::string("/dev/shm") + id.posixName()).c_str(), &st) == 0;
}

// Runs the scenario with spec handed to every process, against a shared server when given.
Outcome runPoint(const Scenario& sc, const std::string& spec, const klptest::TmpDir& dir, e2e::Server* shared) {
  Outcome o;
  const std::string logPath = dir.path() + "uses.log";
  // The command programs' pauses between attempts are cut short.
  const std::string full = spec + (spec.empty() ? "" : ",") + "klpkccmd/sleep=20,klptrc/sleep=20,log=" + logPath;
  std::unique_ptr<e2e::Server> own = shared ? nullptr : startServer(dir, full);
  e2e::Server& server = shared ? *shared : *own;
  std::vector<int> clientPids;
  auto runStep = [&](const std::vector<std::string>& cmd, const std::string& faults) {
    klptest::Background p(argvOf(cmd), envOf(dir, faults));
    if (cmd[0] == "klpkccmd") clientPids.push_back(p.pid());
    return p.wait(kStepLimitMs);
  };
  bool stepRan = server.ready();
  if (stepRan) {
    for (const auto& cmd : sc.before) runStep(cmd, "sleep=100");
    std::ofstream(logPath, std::ios::app) << "mark step\n";
    klptest::ProcessResult r = runStep(sc.step, full);
    std::ofstream(logPath, std::ios::app) << "mark end\n";
    o.stepExit = r.exitCode;
    o.output = r.out + r.err;
    o.took(r, "the step");
    for (const auto& cmd : sc.after) runStep(cmd, "sleep=100");
  }
  if (!shared) {
    stopServer(server, dir, &o, &clientPids, !stepRan || sc.step[1] != "STOP");
    if (klptest::queueExists(server.queue())) o.faults.push_back("the server's queue was left");
  }
  for (int pid : clientPids)
    if (klptest::queueExists(server.queue() + ".CMD" + std::to_string(pid))) o.faults.push_back("a reply queue left");
  if (memoryLeft(dir.path() + kServer + ".KLP.KCAP.TRC")) o.faults.push_back("the trace block was left");
  o.log = klptest::readFile(logPath);
  std::remove(logPath.c_str());
  return o;
}

class FaultWalk : public ::testing::TestWithParam<Scenario> {};

TEST_P(FaultWalk, EveryFailurePointEndsCleanly) {
  if (!hsvFaultCompiledIn()) GTEST_SKIP() << "built without KLP_FAULTS";
  const Scenario& sc = GetParam();
  std::set<std::string> points;
  {
    klptest::TmpDir dir;
    Outcome o = runPoint(sc, "", dir, nullptr);
    ASSERT_TRUE(o.faults.empty()) << o.faults[0] << "\n" << o.output;
    ASSERT_EQ(o.stepExit, 0) << o.output;
    points = usesIn(o.log, &sc);
  }
  std::set<std::string> listed;
  klptest::TmpDir sharedDir;
  std::unique_ptr<e2e::Server> shared;
  for (const Row& row : kRows) {
    if ((" " + std::string(row.scenarios) + " ").find(" " + std::string(sc.name) + " ") == std::string::npos)
      continue;
    for (const char* point : row.points) {
      auto fail = failures(point);
      ASSERT_FALSE(fail.empty()) << point;
      bool share = sc.before.empty() && sc.after.empty() && !sc.serverFromStart &&
                   std::string(point).find("klpkcap/") == std::string::npos;
      if (share && !shared) {
        shared = startServer(sharedDir, "");
        ASSERT_TRUE(shared->ready());
      }
      klptest::TmpDir ownDir;
      Outcome o = runPoint(sc, point, share ? sharedDir : ownDir, share ? shared.get() : nullptr);

      std::string where = std::string(sc.name) + " " + point;
      for (const std::string& f : o.faults) ADD_FAILURE() << where << ": " << f << "\n" << o.output;
      EXPECT_EQ(o.stepExit, row.stepExit) << where << "\n" << o.output;
      if (!share) { EXPECT_EQ(o.serverExit, row.serverExit) << where << "\n" << o.output; }
      for (const char* t : row.texts) {
        std::string want = t == kDone ? sc.done : t;
        bool absent = want[0] == '!';
        if (absent) want.erase(0, 1);
        EXPECT_EQ(o.output.find(want) == std::string::npos, absent)
            << where << (absent ? ": says \"" : ": no \"") << want << "\"\n" << o.output;
      }
      std::set<std::string> fired = usesIn(o.log, nullptr);
      for (const auto& [use, walked] : fail) {
        listed.insert(use);
        EXPECT_TRUE(!walked || fired.count(use)) << where << ": " << use << " unreached";
      }
    }
  }
  for (const std::string& u : points) EXPECT_TRUE(listed.count(u)) << sc.name << ": no row walks " << u;
  if (shared) {
    Outcome o;
    std::vector<int> pids;
    stopServer(*shared, sharedDir, &o, &pids);
    EXPECT_EQ(o.serverExit, 0) << o.output;
    EXPECT_FALSE(klptest::queueExists(shared->queue()));
  }
}

INSTANTIATE_TEST_SUITE_P(Scenarios, FaultWalk, ::testing::ValuesIn(kScenarios),
                         [](const auto& info) { return std::string(info.param.name); });

}  // namespace
