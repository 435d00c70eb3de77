// Fuzz target: one message as the command engine takes it off the server
// queue, whatever its bytes. The engine runs in a private IPC directory, so
// every reply it tries to send finds no queue; the threads are objects whose
// command lists are emptied after each input.
#include <unistd.h>

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>

#include "common/env/klpenv.h"
#include "common/ipc/cmdsengine.h"
#include "common/ipc/ipcmsg.h"
#include "common/msg/klplog.h"
#include "common/msg/msglogger.h"
#include "common/parms/klpparm.h"
#include "common/thread/klpthread.h"
#include "common/thread/ordlist.h"
#include "xqpub/xqpubparms.h"

namespace {

std::string g_dir;
OrdList* g_threads = nullptr;

void removeDir() {
  if (!g_dir.empty()) rmdir(g_dir.c_str());
}

int quietDbCheck(char* text, size_t len) {
  snprintf(text, len, "%s", "AVAILABLE");
  return 0;
}

void setUp() {
  char tmpl[] = "/tmp/klpfuzz.XXXXXX";
  if (mkdtemp(tmpl) != nullptr) {
    g_dir = tmpl;
    atexit(removeDir);
    setenv("TMPDIR", (g_dir + "/").c_str(), 1);
  }
  msgLogger* logger = createMsgLoggerU(5, 0);
  // No destination: the engine's reports are composed but go nowhere.
  for (char sev : {'I', 'W', 'E', 'D'}) logger->setRoutingWord(sev, 0);
  logger->loadBuiltinMsgs(builtinMsgTable);
  klpSetProcessLogger(logger);
  klpThread::prologue(klpMainThread());

  static ParmEntry table[XQPUB_PARM_COUNT];
  buildXqpubParmTable(table);
  int rc = 0;
  xqpubParms* parms = new xqpubParms(table, XQPUB_PARM_COUNT, &rc);
  parms->setParm(0, "FUZZ", PARM_SRC_COMMANDLINE);
  klpSetCurrentParms(parms);
  klpEnv* env = klpGetEnv();
  klpEnvClear(env);
  setEnvNamePrefix(env, "KCAP");
  cmdsSetDbStatusCheck(quietDbCheck);

  g_threads = new OrdList();
  g_threads->makeShared("FuzzThreads", 1);
  const char* names[] = {"AdminThread", "WorkerThread", "PruneThread"};
  for (int i = 0; i < 3; ++i) {
    klpThread* t = new klpThread();
    t->setName(names[i]);
    t->setState(i == 2 ? KLP_THREAD_STOP : KLP_THREAD_REST);
    for (int code = 0; code < KLP_CMD_CODES; ++code)
      if (code % (i + 2) == 0) setCmdInterest(t, code, 1);
    t->cmdList = new OrdList();
    t->cmdList->makeShared(names[i], 1);
    g_threads->putTail(&t->ole);
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static bool ready = (setUp(), true);
  (void)ready;
  // The queue never delivers more than one message's worth.
  if (size > IPC_MAX_MSG_SIZE) size = IPC_MAX_MSG_SIZE;
  // An exact-size copy, so that any read beyond what was received is caught.
  void* copy = malloc(size > 0 ? size : 1);
  if (copy == nullptr) return 0;
  if (size > 0) memcpy(copy, data, size);

  cmdsState st;
  int32_t stopFlag = 0;
  cmdsInitState(&st, CMDS_MODE_ONE_PASS, &stopFlag);
  cmdsHandleMessage(&st, g_threads, size > 0 ? copy : nullptr, size);
  cmdsStartStop(&st, g_threads);
  free(copy);

  for (OrdListElement* e = g_threads->browseHead(); e != nullptr; e = OrdList::browsePrev(e)) {
    klpThread* t = klpThreadOf(e);
    while (OrdListElement* q = t->cmdList->getHead()) {
      MsgQe* qe = reinterpret_cast<MsgQe*>(q);
      if (strnlen(qe->QeString, MSGQE_STRING_SIZE) >= MSGQE_STRING_SIZE) abort();
      deleteMsgQe(qe);
    }
  }
  return 0;
}
