// The process environment: name prefix, IPC directory, program level, module
// list and the server's receiving queue (created, replaced when stale,
// reached from another process, destroyed without leftovers).
#include "common/env/klpenv.h"

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstddef>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>

#include "common/ipc/ipcmsg.h"
#include "common/msg/klplog.h"
#include "common/msg/msglogger.h"
#include "common/parms/klpparm.h"
#include "common/thread/klpthread.h"
#include "common/thread/recoverymgr.h"
#include "common/util/klprc.h"
#include "tests/testing/klptest.h"

namespace {

// A server-like parameter set made current: server name, DEBUG and schema.
struct ServerParms {
  std::unique_ptr<klpParmClass> p;
  ServerParms(const char* server, const char* schema, bool debug = false) {
    const ParmEntry table[3] = {
        makeParmEntry(0, "CAPTURE_SERVER", 0, PARM_STRING, -1, 128, -1, "", 0, 1, 0),
        makeParmEntry(1, "DEBUG", 0, PARM_BOOLEAN, -1, -1, -1, nullptr, 0, 1, 0),
        makeParmEntry(2, "CAPTURE_SCHEMA", 0, PARM_STRING, -1, 128, -1, "KLP", 0, 1, 0),
    };
    int rc = 0;
    p = std::make_unique<klpParmClass>(table, 3, &rc);
    p->setParm(0, server, PARM_SRC_COMMANDLINE);
    if (schema) p->setParm(2, schema, PARM_SRC_COMMANDLINE);
    if (debug) p->setParmBool(1, 1, PARM_SRC_COMMANDLINE);
    klpSetCurrentParms(p.get());
  }
  ~ServerParms() { klpSetCurrentParms(nullptr); }
};

// A process logger writing the log file env.log into dir.
struct LogFile {
  klptest::ProcessLogger logger;
  explicit LogFile(const std::string& dir) : logger(MSG_APP_KLPKCCMD, dir, "env.log") {}
};

// Every test starts from a cleared environment and leaves one behind.
class Env : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_EQ(0, klpEnvClear(env_)); }
  void TearDown() override {
    delEnvIpcQRcvHdl(env_);
    klpEnvClear(env_);
  }
  klpEnv* env_ = klpGetEnv();
  klptest::TmpDir dir_;
  std::string logText() const { return klptest::readFile(dir_.path() + "env.log"); }
};

size_t countOf(const std::string& text, const std::string& what) {
  size_t n = 0;
  for (size_t p = text.find(what); p != std::string::npos; p = text.find(what, p + 1)) ++n;
  return n;
}

// Waits (bounded) for a forked child and answers its exit code.
int reap(pid_t pid) {
  int status = 0;
  for (int i = 0; i < 2000; ++i) {
    if (waitpid(pid, &status, WNOHANG) == pid) return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    usleep(5000);
  }
  kill(pid, SIGKILL);
  waitpid(pid, &status, 0);
  return -1;
}

// A process that puts one request on the queue at path, creating the queue
// first (an earlier server) or attaching to it (a client), and ends.
[[noreturn]] void putRequestAndExit(const char* path, bool create, int32_t func, int32_t subFunc,
                                    const char* text) {
  HSVResID id;
  HSVHIPCQueue q;
  IpcMsg* msg = nullptr;
  hsvRC prc;
  if (hsvIPCGetQueResID(path, HSV_QUEUE_RESID_OPTION, &id) != ECF_OK ||
      (create ? q.create(id, IPC_MAX_MSG_SIZE, HSV_CREATE_OPTION) : q.attach(id)) != ECF_OK ||
      createRequestMsg(&msg, func, subFunc, text) != 0 || putIpcMsg(&q, msg, &prc) != 0)
    _exit(1);
  if (!create) {  // an earlier server ends without cleaning up
    freeIpcMsg(msg);
    q.detach();
  }
  _exit(0);
}

}  // namespace

TEST_F(Env, ProgramLevelRecordedAndSchemaPutBack) {
  LogFile log(dir_.path());
  ServerParms parms("MYDB", "QRS2");
  int32_t sourceBefore = parms.p->getParmSource(2);
  int64_t before = hsvTimeGetUTC().seconds;
  setEnvTovRIB(env_, "xqpubcmd", 9, 7, 8);
  EXPECT_STREQ("xqpubcmd 9.7.8", env_->programLevel);
  EXPECT_GE(env_->startTime, before);
  EXPECT_STREQ("QRS2", parms.p->getParmString(2));
  EXPECT_EQ(sourceBefore, parms.p->getParmSource(2));
  EXPECT_STREQ("QRS2", log.logger->getProgramQualifier());
  std::string text = logText();
  EXPECT_EQ(1u, countOf(text, "KLP0600")) << text;
  EXPECT_NE(std::string::npos, text.find("xqpubcmd 9.7.8")) << text;

  // A long name is cut for the block's fields only; the fields after them
  // keep their contents.
  setEnvTovRIB(env_, "averylongprogramname", 1, 2, 3);
  EXPECT_STREQ("averylongprogramname", getEnvProgramName(env_));
  EXPECT_STREQ("averylong", getEnvJobName(env_));
  EXPECT_STREQ("averylong", env_->appVersion.rel.programName);
  EXPECT_EQ(0, memcmp(reinterpret_cast<const char*>(&env_->appVersion) + 178, "0801", 4));
}

TEST_F(Env, NamePrefixJoinsServerSchemaAndWord) {
  EXPECT_EQ(KLP_RC_NO_SERVER, setEnvNamePrefix(env_, "KCAP"));  // no parameter set yet
  EXPECT_EQ(nullptr, getEnvNamePrefix(env_));
  for (const char* schema : {static_cast<const char*>(nullptr), "KLP."}) {
    // The schema's default KLP; a trailing dot is dropped.
    ServerParms parms("MYDB", schema);
    ASSERT_EQ(0, setEnvNamePrefix(env_, "KCAP"));
    EXPECT_STREQ("MYDB.KLP.KCAP", getEnvNamePrefix(env_));
  }
  char out[32];
  EXPECT_EQ(0, klpBuildNamePrefix(out, sizeof out, "S1", "A", "KAPP"));
  EXPECT_STREQ("S1.A.KAPP", out);
  EXPECT_EQ(KLP_RC_NO_SERVER, klpBuildNamePrefix(out, sizeof out, "", "A", "KAPP"));
  EXPECT_EQ(KLP_RC_TOO_LONG, klpBuildNamePrefix(out, 9, "S1", "A", "KAPP"));
  EXPECT_STREQ("", out);
  EXPECT_EQ(0, klpBuildNamePrefix(out, 10, "S1", "A", "KAPP"));

  // A prefix longer than its 160 characters is refused whole.
  ServerParms parms("MYDB", nullptr);
  ASSERT_EQ(0, setEnvNamePrefix(env_, "KCAP"));
  parms.p->setParm(0, std::string(128, 'S').c_str(), PARM_SRC_COMMANDLINE);
  parms.p->setParm(2, std::string(40, 'C').c_str(), PARM_SRC_COMMANDLINE);
  EXPECT_EQ(KLP_RC_TOO_LONG, setEnvNamePrefix(env_, "KCAP"));
  EXPECT_STREQ("MYDB.KLP.KCAP", getEnvNamePrefix(env_));  // the old one stays
  // Exactly 160 characters still fit.
  parms.p->setParm(2, std::string(26, 'C').c_str(), PARM_SRC_COMMANDLINE);
  ASSERT_EQ(0, setEnvNamePrefix(env_, "KCAP"));
  EXPECT_EQ(160u, strlen(getEnvNamePrefix(env_)));
}

TEST_F(Env, IpcDirectoryFromTmpdirFilledOnce) {
  setenv("TMPDIR", "/x/tmp", 1);
  EXPECT_STREQ("/x/tmp/", getEnvIPCDir(env_));
  setenv("TMPDIR", "/somewhere/else/", 1);
  EXPECT_STREQ("/x/tmp/", getEnvIPCDir(env_));  // kept for the process
  // Unset, empty or too long: the default.
  std::string tooLong(2000, 'd');
  const char* cases[][2] = {{"/somewhere/else/", "/somewhere/else/"},
                            {nullptr, "/tmp/"}, {"", "/tmp/"}, {tooLong.c_str(), "/tmp/"}};
  for (const auto& c : cases) {
    klpEnvClear(env_);
    c[0] ? setenv("TMPDIR", c[0], 1) : unsetenv("TMPDIR");
    EXPECT_STREQ(c[1], getEnvIPCDir(env_)) << (c[0] ? c[0] : "(unset)");
  }

  klpEnvClear(env_);
  setenv("TMPDIR", "/d/t", 1);
  ServerParms parms("MYDB", nullptr);
  ASSERT_EQ(0, setEnvNamePrefix(env_, "KCAP"));
  char path[256];
  ASSERT_EQ(0, ipcEnvServerQueuePath(path, sizeof path));
  EXPECT_STREQ("/d/t/MYDB.KLP.KCAP.IPC", path);
  ASSERT_EQ(0, ipcEnvReplyQueuePath(path, sizeof path, 4711));
  EXPECT_STREQ("/d/t/MYDB.KLP.KCAP.IPC.CMD4711", path);
}

TEST_F(Env, ModuleListHoldsTheTableThenTheAddedRecords) {
  klpModuleRecord added[2] = {};
  strcpy(added[0].name, "server.cpp");
  strcpy(added[1].name, "other.cpp");
  setEnvModServ(env_, added, 2);
  klpModuleList* list = env_->moduleList;
  ASSERT_NE(nullptr, list);
  EXPECT_EQ(0, memcmp(list->eyeCatcher, "KLPSMODL\0", 9));
  EXPECT_EQ(KLP_MODULE_TABLE_COUNT + 2, list->count);
  klpModuleRecord* rec = klpModuleRecords(list);
  EXPECT_EQ(20u, strlen(rec[0].compileStamp));  // "Mon dd yyyy hh:mm:ss"
  EXPECT_STREQ("server.cpp", rec[KLP_MODULE_TABLE_COUNT].name);
  EXPECT_STREQ("other.cpp", rec[KLP_MODULE_TABLE_COUNT + 1].name);
  setEnvModServ(env_, nullptr, 0);  // replaces the list
  EXPECT_EQ(KLP_MODULE_TABLE_COUNT, env_->moduleList->count);
}

TEST_F(Env, ReceivingQueueCreatedAndDestroyed) {
  std::string path = dir_.path() + "MYDB.KLP.KCAP.IPC";
  std::string outFile = dir_.path() + "server.out";
  fflush(stdout);
  // A server process: its main thread is registered, so the queue is also
  // a recovery resource of that thread.
  pid_t pid = fork();
  if (pid == 0) {
    if (!freopen(outFile.c_str(), "w", stdout)) _exit(90);
    LogFile log(dir_.path());
    ServerParms parms("MYDB", nullptr, /*debug=*/true);
    klpThread* self = klpMainThread();
    if (klpThread::prologue(self) != 0) _exit(91);
    if (setEnvNamePrefix(env_, "KCAP") != 0 || setEnvIpcQRcvHdl(env_) != 0) _exit(92);
    if (!getEnvIpcQRcvHdl(env_) || !klptest::queueExists(path)) _exit(93);
    if (self->rcvyMgr.resList.count != 1) _exit(94);
    if (setEnvIpcQRcvHdl(env_) != 0 || self->rcvyMgr.resList.count != 1) _exit(95);
    if (klpEnvClear(env_) != KLP_RC_BAD_PARM) _exit(96);  // not while the queue lives
    delEnvIpcQRcvHdl(env_);
    if (getEnvIpcQRcvHdl(env_) || klptest::queueExists(path)) _exit(97);
    if (self->rcvyMgr.resList.count != 0) _exit(98);
    delEnvIpcQRcvHdl(env_);  // nothing left to destroy: harmless
    fflush(stdout);
    _exit(0);
  }
  ASSERT_EQ(0, reap(pid));
  EXPECT_FALSE(klptest::queueExists(path));
  std::string out = klptest::readFile(outFile);
  EXPECT_EQ(0u, out.find("keyPath to contruct IPC = " + path + "\n")) << out;
  std::string text = logText();
  for (auto [id, n] : {std::pair{"KLP0594", 1u}, {"KLP0595", 1u}, {"KLP0592", 0u}, {"KLP0589", 0u}})
    EXPECT_EQ(n, countOf(text, id)) << id << "\n" << text;
  EXPECT_NE(std::string::npos, text.find("<Klpenv:delEnvIpcQRcvHdl>")) << text;
  EXPECT_NE(std::string::npos, text.find("(mqueue, ")) << text;
}

TEST_F(Env, ReceivingQueueDestroyedWhenTheServerTraps) {
  std::string path = dir_.path() + "MYDB.KLP.KCAP.IPC";
  pid_t pid = fork();
  if (pid == 0) {
    ServerParms parms("MYDB", nullptr);
    klpThread* self = klpMainThread();
    if (klpThread::prologue(self) != 0) _exit(91);
    if (KLP_SET_RECOVERY_POINT(self->rcvyMgr) != 0) {
      // Back from the signal: the resources have run.
      recoveryMgr::erRecover(&self->rcvyMgr, self);
      _exit(getEnvIpcQRcvHdl(env_) == nullptr && !klptest::queueExists(path) ? 0 : 3);
    }
    if (setEnvNamePrefix(env_, "KCAP") != 0 || setEnvIpcQRcvHdl(env_) != 0) _exit(92);
    if (!klptest::queueExists(path)) _exit(93);
    raise(SIGINT);
    _exit(94);
  }
  EXPECT_EQ(0, reap(pid));
  EXPECT_FALSE(klptest::queueExists(path));
}

TEST_F(Env, StaleQueueOfAnEarlierRunIsReplaced) {
  ServerParms parms("MYDB", nullptr);
  ASSERT_EQ(0, setEnvNamePrefix(env_, "KCAP"));
  std::string path = dir_.path() + "MYDB.KLP.KCAP.IPC";

  // An earlier server process created the queue, left a request on it and
  // ended without cleaning up.
  pid_t pid = fork();
  if (pid == 0) putRequestAndExit(path.c_str(), true, IPC_FUNC_STOP, 0, nullptr);
  ASSERT_EQ(0, reap(pid));
  ASSERT_TRUE(klptest::queueExists(path));

  // The next run of the server.
  pid = fork();
  if (pid == 0) {
    LogFile log(dir_.path());
    klpThread* self = klpMainThread();
    if (klpThread::prologue(self) != 0) _exit(91);
    if (setEnvIpcQRcvHdl(env_) != 0) _exit(92);
    if (getEnvIpcQRcvHdl(env_)->hasMessage()) _exit(93);  // the stale request came along
    delEnvIpcQRcvHdl(env_);
    _exit(0);
  }
  ASSERT_EQ(0, reap(pid));
  EXPECT_FALSE(klptest::queueExists(path));
  std::string text = logText();
  size_t attached = text.find("KLP0592"), destroyed = text.find("KLP0595"),
         created = text.find("KLP0594");
  ASSERT_NE(std::string::npos, created) << text;  // the last of the three
  EXPECT_LT(attached, destroyed);
  EXPECT_LT(destroyed, created);
  EXPECT_EQ(2u, countOf(text, "KLP0595")) << "replaced, then destroyed at the end\n" << text;
}

TEST_F(Env, AnotherProcessReachesTheReceivingQueue) {
  EXPECT_EQ(KLP_RC_NO_SERVER, setEnvIpcQRcvHdl(env_));  // no name: no ".IPC" for everyone
  EXPECT_EQ(nullptr, getEnvIpcQRcvHdl(env_));
  ServerParms parms("S1", "A");
  ASSERT_EQ(0, setEnvNamePrefix(env_, "KCAP"));
  ASSERT_EQ(0, setEnvIpcQRcvHdl(env_));

  pid_t pid = fork();
  if (pid == 0) {
    // A client: attaches by the path alone and sends a CHGPARMS request.
    char path[512];
    ipcServerQueuePath(path, sizeof path, getenv("TMPDIR"), "S1.A.KCAP");
    putRequestAndExit(path, false, IPC_FUNC_CHGPARMS, 7, "Y");
  }
  char buf[IPC_MAX_MSG_SIZE];
  size_t len = 0;
  ASSERT_EQ(ECF_OK, getEnvIpcQRcvHdl(env_)->get(buf, sizeof buf, &len, 20000));
  EXPECT_EQ(0, reap(pid));
  IpcMsgView view;
  ASSERT_EQ(0, ipcDecodeMsg(buf, len, &view));
  EXPECT_EQ(IPC_FUNC_CHGPARMS, view.header.func);
  EXPECT_EQ(7, view.header.subFunc);
  EXPECT_EQ(pid, view.header.senderPid);
  EXPECT_EQ(46u, len);
  char text[8];
  ipcPayloadText(view, text, sizeof text);
  EXPECT_STREQ("Y", text);
  delEnvIpcQRcvHdl(env_);
  EXPECT_FALSE(klptest::queueExists(dir_.path() + "S1.A.KCAP.IPC"));
}
