// The process environment: program level, name prefix, IPC directory, receiving queue.
#include "common/env/klpenv.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <mqueue.h>
#include <unistd.h>

#include <cstring>
#include <string>

#include "common/ipc/ipcmsg.h"
#include "common/msg/msglogger.h"
#include "common/thread/klpthread.h"
#include "common/thread/recoverymgr.h"
#include "common/util/klprc.h"
#include "tests/testing/klptest.h"
#include "xqpub/xqpubparms.h"

namespace {

// The server's parameter set made current, with a server name and schema.
struct ServerParms {
  ParmEntry t[XQPUB_PARM_COUNT];
  int rc = (buildXqpubParmTable(t), 0);
  xqpubParms p{t, XQPUB_PARM_COUNT, &rc};
  ServerParms(const char* server, const char* schema, bool debug = false) {
    p.setParm(0, server, PARM_SRC_COMMANDLINE);
    if (schema) p.setParm(2, schema, PARM_SRC_COMMANDLINE);
    p.setParmBool(1, debug, PARM_SRC_COMMANDLINE);
    klpSetCurrentParms(&p);
  }
  ~ServerParms() { klpSetCurrentParms(nullptr); }
};

// A cleared environment before and after; the logger keeps what is issued.
struct Env : ::testing::Test {
  void SetUp() override {
    ASSERT_EQ(0, klpEnvClear(env_));
    for (char severity : {'E', 'W'}) log_->setRoutingWord(severity, 0);  // kept, not printed
  }
  void TearDown() override { klpEnvClear(env_); }
  klpEnv* env_ = klpGetEnv();
  klptest::TmpDir dir_;
  klptest::ProcessLogger log_;
};

}  // namespace

TEST_F(Env, ProgramLevelRecordedAndSchemaPutBack) {
  ServerParms parms("MYDB", "QRS2");
  int64_t before = hsvTimeGetUTC().seconds;
  setEnvTovRIB(env_, "xqpubcmd", 9, 7, 8);
  setEnvTovRIB(env_, "averylongprogramname", 1, 2, 3);
  EXPECT_EQ(log_.take(), (std::vector<std::string>{"600 <setEnvTovRIB> 35: xqpubcmd 9.7.8",
                                                    "600 <setEnvTovRIB> 35: averylongprogramname 1.2.3"}));
  EXPECT_GE(env_->startTime, before);
  EXPECT_EQ(parms.p.getParmString(2) + std::to_string(parms.p.getParmSource(2)) +  // the schema
                log_.get()->getProgramQualifier(), "QRS22QRS2");  // is back, also in the logger
  // A long name is cut for the block's fields only; the fields after them keep their contents.
  const klpReleaseBlock& rel = env_->appVersion.rel;
  EXPECT_EQ(rel.version * 100 + rel.release * 10 + rel.modification, 123);
  EXPECT_EQ(std::string(rel.programFixLevel, 8) + std::string(rel.baseFixLevel, 33), std::string(41, '\0'));
  EXPECT_EQ(std::string(getEnvProgramName(env_)) + " " + getEnvJobName(env_) + " " + rel.programName,
            "averylongprogramname averylong averylong");
  EXPECT_EQ(0, memcmp(reinterpret_cast<const char*>(&env_->appVersion) + 178, "0801", 4));
}

TEST_F(Env, NamePrefixAndIpcDirectory) {
  EXPECT_EQ(KLP_RC_NO_SERVER, setEnvNamePrefix(env_, "KCAP"));  // no parameter set yet
  EXPECT_EQ(nullptr, getEnvNamePrefix(env_));
  // A trailing dot of the schema is dropped; a prefix longer than its 160
  // characters is refused whole and the old one stays; the last one names the reply queue.
  ServerParms parms("MYDB", nullptr);
  const std::string s128(128, 'S'), c26(26, 'C'), c27(27, 'C'), kept = s128 + "." + c26 + ".KCAP";
  const struct { std::string server, schema; int rc; std::string prefix; } cases[] = {
      {"MYDB", "KLP", 0, "MYDB.KLP.KCAP"}, {"MYDB", "KLP.", 0, "MYDB.KLP.KCAP"},
      {s128, c27, KLP_RC_TOO_LONG, "MYDB.KLP.KCAP"}, {s128, c26, 0, kept},
      {"", "KLP", KLP_RC_NO_SERVER, kept}, {"DB", "S", 0, "DB.S.KCAP"}};
  for (const auto& c : cases) {
    parms.p.setParm(0, c.server.c_str(), PARM_SRC_COMMANDLINE);
    parms.p.setParm(2, c.schema.c_str(), PARM_SRC_COMMANDLINE);
    EXPECT_EQ(c.rc, setEnvNamePrefix(env_, "KCAP")) << c.schema;
    EXPECT_EQ(c.prefix, getEnvNamePrefix(env_));
  }
  // IPC directory: TMPDIR and "/", filled once; else /tmp/ (an empty value's next byte is never read).
  const std::string longest(1038, 'd');
  const std::pair<std::string, std::string> dirs[] = {
      {"TMPDIR=/x/tmp", "/x/tmp/"}, {"TMPDIR=/else/", "/else/"}, {"", "/tmp/"},
      {std::string("TMPDIR=\0X", 9), "/tmp/"}, {"TMPDIR=" + longest + "d", "/tmp/"},
      {"TMPDIR=" + longest, longest + "/"}};
  for (auto [entry, dir] : dirs) {
    entry.empty() ? unsetenv("TMPDIR") : putenv(entry.data());
    getEnvIPCDir(env_);
    setenv("TMPDIR", "/somewhere/else/", 1);
    EXPECT_EQ(dir, getEnvIPCDir(env_)) << entry;
    env_->ipcDir[0] = '\0';
  }
  setenv("TMPDIR", "/d/t", 1);
  char path[256];
  ASSERT_EQ(0, ipcEnvReplyQueuePath(path, sizeof path, 4711));
  EXPECT_STREQ("/d/t/DB.S.KCAP.IPC.CMD4711", path);
}

// The receiving queue's life in a server process, step by step: what each
// step answers, prints and logs (the queue's name shows as Q, its path as P).
TEST_F(Env, ReceivingQueueStepsAndTheirRecords) {
  const std::string path = dir_.path() + "MYDB.KLP.KCAP.IPC";
  HSVResID id;
  ASSERT_EQ(ECF_OK, hsvIPCGetQueResID(path.c_str(), HSV_QUEUE_RESID_OPTION, &id));
  // Puts one request, on a queue a crashed server left behind or on the live one.
  auto putOne = [&](bool create) {
    HSVHIPCQueue q;
    IpcMsg* msg = nullptr;
    hsvRC prc;
    bool ok = (create ? q.create(id, IPC_MAX_MSG_SIZE, HSV_CREATE_OPTION) : q.attach(id)) == ECF_OK &&
              createRequestMsg(&msg, IPC_FUNC_CHGPARMS, 7, "Y") == 0 && putIpcMsg(&q, msg, &prc) == 0;
    freeIpcMsg(msg);
    q.detach();
    return ok ? 0 : 1;
  };
  klptest::Child c = klptest::inChild(dir_.path(), [&] {
    auto step = [&](const char* what, int rc) {
      fflush(stdout);
      printf("%s: %d\n", what, rc);
      for (const std::string& r : log_.take()) printf("%s\n", r.c_str());
    };
    step("no name", setEnvIpcQRcvHdl(env_));  // not ".IPC" for every nameless server
    ServerParms parms("MYDB", nullptr, /*debug=*/true);
    klpThread* self = klpMainThread();
    if (klpThread::prologue(self) != 0 || setEnvNamePrefix(env_, "KCAP") != 0) return 90;
    if (KLP_SET_RECOVERY_POINT(self->rcvyMgr) != 0) {  // back from the trap at the end
      recoveryMgr::erRecover(&self->rcvyMgr, self);
      log_.take();  // the recovery manager's own reports
      step("trapped", getEnvIpcQRcvHdl(env_) != nullptr || klptest::queueExists(path));
      return 0;
    }
    step("create", setEnvIpcQRcvHdl(env_));
    step("again", setEnvIpcQRcvHdl(env_));
    step("resources", self->rcvyMgr.resList.count);
    klptest::Child other = klptest::inChild(dir_.path(), [&] { return putOne(false); });
    char buf[IPC_MAX_MSG_SIZE];
    size_t len = 0;
    IpcMsgView view{};
    bool got = getEnvIpcQRcvHdl(env_)->get(buf, sizeof buf, &len, 20000) == ECF_OK &&
               ipcDecodeMsg(buf, len, &view) == 0;
    step("reached by another process", other.exitCode + (got ? view.header.subFunc : -1));
    delEnvIpcQRcvHdl(env_);
    step("destroyed", klptest::queueExists(path) + self->rcvyMgr.resList.count);
    step("destroyed again", (delEnvIpcQRcvHdl(env_), 0));
    step("stale", putOne(true) + setEnvIpcQRcvHdl(env_));
    step("stale request kept", getEnvIpcQRcvHdl(env_)->hasMessage());
    delEnvIpcQRcvHdl(env_);
    log_.take();
    // A queue open to others in the way: neither used nor replaced.
    mqd_t q = mq_open(id.posixName(), O_CREAT | O_EXCL | O_RDWR, 0600, nullptr);
    fchmod(q, 0644);
    step("in the way", setEnvIpcQRcvHdl(env_));
    step("queue object", getEnvIpcQRcvHdl(env_) != nullptr);
    mq_close(q);
    mq_unlink(id.posixName());
    // The queue is a recovery resource of the thread: a trap destroys it.
    step("create", setEnvIpcQRcvHdl(env_));
    step("clear", klpEnvClear(env_));  // refused while the queue lives
    raise(SIGINT);
    return 91;
  });
  EXPECT_EQ(0, c.exitCode);
  std::string out = c.out;
  for (auto [from, to] : {std::pair{std::string("(mqueue, ") + id.posixName() + ", 48)", "Q"}, {path, "P"}})
    for (size_t at; (at = out.find(from)) != std::string::npos;) out.replace(at, from.size(), to);
  EXPECT_EQ(out, klptest::readFile(KLP_SOURCE_DIR "/common/env/receiving_queue.golden"));
  EXPECT_FALSE(klptest::queueExists(path));
}

