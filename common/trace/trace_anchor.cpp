// The process's trace anchor and the life of the shared trace block in it:
// creating and initialising the block, attaching a server to it, noticing
// that it was turned off, letting go of it, the version check, the
// printable key and the trace-on notice to a server.
#include "common/trace/trace_anchor.h"

#include <algorithm>
#include <new>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "common/ipc/ipcmsg.h"
#include "common/trace/trc_internal.h"
#include "common/trace/trcread.h"
#include "common/trace/trcwrite.h"

namespace {

trcAnchor* g_anchor = nullptr;  // the process-wide pointer; null until initialised
int64_t g_stopSeenAt = 0;       // when trcCheckStop first saw the block Stop
bool g_application = false;     // this process is the traced server (trcDeclareApplication)

trcAnchor& anchor() { return g_trcAnchorStorage; }

void setState(uint32_t state) {
  __atomic_store_n(&g_trcAnchorStorage.state, state, __ATOMIC_SEQ_CST);
}

// "<key part 1><key part 2>.TRC"; false when it does not fit.
bool blockPath(const char* keyPart1, const char* keyPart2, char (&path)[2 * TRC_KEY_SIZE + 8]) {
  int n = snprintf(path, sizeof path, "%s%s.TRC", keyPart1 ? keyPart1 : "",
                   keyPart2 ? keyPart2 : "");
  return n > 0 && static_cast<size_t>(n) < sizeof path;
}

void copyModules(trcBlockHeader* b, const klpModuleList* list) {
  int n = std::min<int>(list->count, TRC_MODULES);
  memcpy(b->modules, klpModuleRecords(const_cast<klpModuleList*>(list)),
         static_cast<size_t>(n) * sizeof(klpModuleRecord));
  b->moduleCount = static_cast<uint16_t>(n);
}

// Lets go of the block after the anchor stopped tracing. The traced
// application withdraws its mark; a Stop block is then destroyed unless the
// application still holds it (it frees the block itself), detached otherwise.
void leaveBlock() {
  trcBlockHeader* b = anchor().block;
  if (b == nullptr) return;
  trcLockBuffer(b);
  if (g_application) b->appAttached = 0;
  bool held = b->appAttached == TRC_APP_ATTACHED;
  trcUnlockBuffer(b);
  trcDropBlock(b->status == TRC_STATE_STOP && !held);
}

}  // namespace

// A caller may pass the anchor's own keys: the copy must survive src being
// dst itself.
void trcCopyKey(char (&dst)[TRC_KEY_SIZE], const char* src) {
  if (src == nullptr) src = "";
  size_t n = strnlen(src, TRC_KEY_SIZE - 1);
  memmove(dst, src, n);
  dst[n] = '\0';
}

void trcInitAnchor() {
  g_anchor = &g_trcAnchorStorage;
  memset(g_anchor, 0, sizeof *g_anchor);
  g_anchor->state = TRC_STATE_INITIAL;
  g_anchor->pid = hsvProcessID();
  g_stopSeenAt = 0;
  g_application = false;
  trcint::prepareWriters();
}

void trcDeclareApplication() { g_application = true; }

void trcStartTracing(trcBlockHeader* block) {
  if (g_application) {
    if (trcThreadTablesInUse()) trcCopyThreadTables(block);
    block->appAttached = TRC_APP_ATTACHED;
  }
  setState(TRC_STATE_RUNNING);
}

trcAnchor* trcGetAnchor() { return g_anchor; }

hsvRC trcOpenBlock(const char* keyPart1, const char* keyPart2, HSVHIPCMemory** memory,
                   trcBlockHeader** block) {
  *memory = nullptr;
  *block = nullptr;
  char path[2 * TRC_KEY_SIZE + 8];
  if (!blockPath(keyPart1, keyPart2, path)) return ECF_INVALID_ARGUMENT;
  HSVResID id;
  hsvRC rc = hsvIPCGetResID(path, HSV_MEMORY_RESID_OPTION, &id);
  if (rc != ECF_OK) return rc;
  HSVHIPCMemory* m = new (std::nothrow) HSVHIPCMemory;
  if (m == nullptr) return ECF_NO_MEMORY;
  rc = m->attach(id);  // refuses a block of another user or open to others
  if (rc == ECF_OK && (m->getAddress() == nullptr || m->getSize() < TRC_HEADER_SIZE))
    rc = ECF_INVALID_ARGUMENT;
  if (rc != ECF_OK) {
    delete m;  // unmaps
    return rc;
  }
  *memory = m;
  *block = static_cast<trcBlockHeader*>(m->getAddress());
  return ECF_OK;
}

void trcHoldBlock(HSVHIPCMemory* memory, trcBlockHeader* block) {
  anchor().memory = memory;
  trcint::publishBlock(block, memory->getSize());
}

void trcDropBlock(bool destroy) {
  trcAnchor& a = anchor();
  trcint::publishBlock(nullptr, 0);
  if (a.memory != nullptr) {
    if (destroy)
      a.memory->destroy();
    else
      a.memory->detach();
    delete a.memory;
  }
  a.memory = nullptr;
}

int trcAttach(const char* keyPart1, const char* keyPart2, const klpAppVersion* appVersion,
              const klpModuleList* moduleList) {
  trcAnchor& a = anchor();
  if (a.block != nullptr) return 0;
  HSVHIPCMemory* memory = nullptr;
  trcBlockHeader* b = nullptr;
  hsvRC rc = trcOpenBlock(keyPart1, keyPart2, &memory, &b);
  if (rc == ECF_NOT_FOUND) return 0;
  if (rc != ECF_OK) return TRC_RC_NO_ADDRESS;
  setState(TRC_STATE_STARTING);
  trcHoldBlock(memory, b);
  if (b->status != TRC_STATE_RUNNING) {
    setState(TRC_STATE_STOPPED);
    leaveBlock();
    return 0;
  }
  if (!trcCheckVersion(b, nullptr, false)) {
    setState(TRC_STATE_STOPPED);
    trcDropBlock(false);
    return TRC_RC_INCOMPATIBLE;
  }
  trcCopyKey(a.keyPart1, keyPart1);
  trcCopyKey(a.keyPart2, keyPart2);
  if (g_application) {  // the block describes the traced program only
    trcLockBuffer(b);
    if (appVersion != nullptr) memcpy(&b->appVersion, appVersion, sizeof b->appVersion);
    if (moduleList != nullptr) copyModules(b, moduleList);
    trcUnlockBuffer(b);
  }
  trcStartTracing(b);
  return 0;
}

void trcDetach() {
  setState(TRC_STATE_STOPPED);
  leaveBlock();
  g_stopSeenAt = 0;
}

void trcCheckStop() {
  trcBlockHeader* b = anchor().block;
  if (b == nullptr || b->status != TRC_STATE_STOP) return;
  int64_t now = hsvTimeGetUTC().seconds;
  if (g_stopSeenAt == 0) {
    setState(TRC_STATE_STOPPING);
    g_stopSeenAt = now;
  } else if (now - g_stopSeenAt > TRC_STOP_GRACE_SECONDS) {
    trcDetach();
  }
}

void trcFree() {
  setState(TRC_STATE_STOPPED);
  trcDropBlock(true);
}

int trcCreate(uint32_t bufferSize, const char* keyPart1, const char* keyPart2,
              const char* fileName, uint32_t maxFileSize, uint16_t globalFilter, bool standalone) {
  trcAnchor& a = anchor();
  FILE* out = trcOut();
  if (a.block != nullptr) {
    if (a.block->status != TRC_STATE_STOP) return TRC_RC_NOT_CREATED;
    if (a.block->appAttached == TRC_APP_ATTACHED) hsvSleep(60);
    trcDropBlock(true);
  }
  setState(TRC_STATE_STARTING);

  char path[2 * TRC_KEY_SIZE + 8];
  HSVResID id;
  hsvRC rc = blockPath(keyPart1, keyPart2, path) ? hsvIPCGetResID(path, HSV_MEMORY_RESID_OPTION, &id)
                                                 : ECF_INVALID_ARGUMENT;
  if (rc != ECF_OK) {
    fprintf(out, "Function 'hsvIPCGetResID' for path '%s' failed with HSVE reason '%s'.\n", path,
            ecfErrorGetDescription(rc));
    return TRC_RC_NOT_CREATED;
  }
  HSVHIPCMemory* memory = new (std::nothrow) HSVHIPCMemory;
  rc = memory != nullptr ? memory->create(id, bufferSize, HSV_CREATE_OPTION) : ECF_NO_MEMORY;
  if (rc != ECF_OK) {
    char* key = trcKeyText(keyPart1, keyPart2);
    fprintf(out, "Function 'HSVHIPCMemory::create' with IPC key '%s' failed with HSVE reason '%s'.\n",
            key != nullptr ? key : "UNKNOWN", ecfErrorGetDescription(rc));
    free(key);
    delete memory;
    return rc == ECF_NO_MEMORY ? TRC_RC_NO_MEMORY : TRC_RC_NOT_CREATED;
  }
  auto* b = static_cast<trcBlockHeader*>(memory->getAddress());
  if (b == nullptr || memory->getSize() < TRC_HEADER_SIZE) {
    memory->destroy();
    delete memory;
    return TRC_RC_NO_ADDRESS;
  }

  b->status = TRC_STATE_STARTING;
  b->bufferLock = 0;
  b->fileLock = 0;
  trcLockBuffer(b);
  trcHoldBlock(memory, b);
  trcCopyKey(a.keyPart1, keyPart1);
  trcCopyKey(a.keyPart2, keyPart2);

  snprintf(b->platform, sizeof b->platform, "%s", TRC_PLATFORM);
  snprintf(b->structVersion, sizeof b->structVersion, "%s", TRC_STRUCT_VERSION);
  snprintf(b->symbolVersion, sizeof b->symbolVersion, "%s", TRC_SYMBOL_VERSION);
  b->componentCount = TRC_COMPONENTS;
  b->functionsPerComponent = TRC_FUNCTIONS;
  memset(&b->traceRelease, 0, sizeof b->traceRelease);
  memset(&b->appVersion, 0, sizeof b->appVersion);
  b->moduleCount = 0;
  memset(b->modules, 0, sizeof b->modules);
  klpEnv* env = klpGetEnv();
  memcpy(&b->appVersion, &env->appVersion, sizeof b->appVersion);
  if (env->moduleList != nullptr) copyModules(b, env->moduleList);

  if (trcThreadTablesInUse())
    trcCopyThreadTables(b);
  else
    trcClearThreadTables(b);
  if (!standalone && g_application) b->appAttached = TRC_APP_ATTACHED;

  snprintf(b->traceRelease.programName, sizeof b->traceRelease.programName, "%s",
           TRC_RELEASE_NAME);
  b->traceRelease.version = TRC_VERSION;
  b->traceRelease.release = TRC_RELEASE;
  b->traceRelease.modification = TRC_MODIFICATION;
  snprintf(b->traceRelease.uniqueName, sizeof b->traceRelease.uniqueName, "%s",
           keyPart2 != nullptr ? keyPart2 : "");
  HSVTimeUTC now = hsvTimeGetUTC();
  memset(&b->attachTime, 0, sizeof b->attachTime);
  b->attachTime.seconds = now.seconds;
  b->attachTime.microseconds = now.microseconds;

  b->dataOffset = TRC_HEADER_SIZE;
  b->writeOffset = b->oldestOffset = b->highWaterOffset = b->entryCount = 0;
  b->fileFull = 0;
  b->bufferSize = bufferSize;
  b->maxFileSize = maxFileSize;
  b->globalFilter = globalFilter;
  memset(b->componentFilters, 0, sizeof b->componentFilters);
  memset(b->functionFilters, 0, sizeof b->functionFilters);
  memset(b->fileName, 0, sizeof b->fileName);
  if (fileName != nullptr && fileName[0] != '\0') {
    snprintf(b->fileName, sizeof b->fileName, "%s", fileName);
    trcFlushToFile(b, false);
  }

  b->status = TRC_STATE_RUNNING;
  trcUnlockBuffer(b);
  setState(TRC_STATE_RUNNING);
  return 0;
}

bool trcCheckVersion(const trcBlockHeader* h, const char* fileName, bool report) {
  bool compatible = strncmp(h->platform, TRC_PLATFORM, sizeof h->platform) == 0 &&
                    strncmp(h->structVersion, TRC_STRUCT_VERSION, sizeof h->structVersion) == 0 &&
                    h->componentCount <= TRC_COMPONENTS &&
                    h->functionsPerComponent <= TRC_FUNCTIONS;
  if (!report) return compatible;
  const char* word1 = fileName != nullptr ? "File" : "Shared";
  const char* word2 = fileName != nullptr ? fileName : "buffer";
  // The header's texts come from another process or a file: never beyond
  // their fields.
  const int pw = static_cast<int>(strnlen(h->platform, sizeof h->platform));
  const int sw = static_cast<int>(strnlen(h->structVersion, sizeof h->structVersion));
  const int yw = static_cast<int>(strnlen(h->symbolVersion, sizeof h->symbolVersion));
  FILE* out = trcOut();
  if (!compatible) {
    fprintf(out,
            "%s %s was generated by an incompatible Trace version.\nIt uses: platform %.*s, "
            "trace structure %.*s, and symbol table %.*s (%dx%d)\nThis is: platform %s, trace "
            "structure %s, and symbol table %s (%dx%d)\n",
            word1, word2, pw, h->platform, sw, h->structVersion, yw, h->symbolVersion,
            h->componentCount, h->functionsPerComponent, TRC_PLATFORM, TRC_STRUCT_VERSION,
            TRC_SYMBOL_VERSION, TRC_COMPONENTS, TRC_FUNCTIONS);
    return false;
  }
  char symbols[sizeof h->symbolVersion + 1];
  snprintf(symbols, sizeof symbols, "%.*s", yw, h->symbolVersion);
  if (atoi(symbols) != TRC_SYMBOL_VERSION_NUMBER)
    fprintf(out,
            "Warning: %s %s uses a different symbol table (%s, %dx%d) than this version of "
            "Trace (%s, %dx%d).\n",
            word1, word2, symbols, h->componentCount, h->functionsPerComponent,
            TRC_SYMBOL_VERSION, TRC_COMPONENTS, TRC_FUNCTIONS);
  return true;
}

char* trcKeyText(const char* keyPart1, const char* keyPart2) {
  char path[2 * TRC_KEY_SIZE + 8];
  HSVResID id;
  if (!blockPath(keyPart1, keyPart2, path) ||
      hsvIPCGetResID(path, HSV_MEMORY_RESID_OPTION, &id) != ECF_OK)
    return nullptr;
  return ipcNewResIDText(&id);
}

int _trcSendIPCMsg(const char* keyPart1, const char* keyPart2, int function) {
  char path[2 * TRC_KEY_SIZE + 8];
  HSVResID id;
  if (ipcServerQueuePath(path, sizeof path, keyPart1, keyPart2) != 0 ||
      hsvIPCGetQueResID(path, HSV_QUEUE_RESID_OPTION, &id) != ECF_OK)
    return 0;
  HSVHIPCQueue queue;
  if (queue.attach(id) != ECF_OK) return 0;  // no server to tell
  IpcMsg* msg = static_cast<IpcMsg*>(calloc(1, IPC_HEADER_SIZE));
  if (msg == nullptr) {
    fputs("\nUnable to allocate storage for IPC message.\n", trcOut());
    return TRC_RC_NO_MEMORY;
  }
  msg->msgLength = static_cast<int32_t>(IPC_HEADER_SIZE);
  msg->func = function;
  msg->subFunc = 1;  // a notice: the server answers nothing
  msg->pieceCount = 1;
  hsvRC prc = ECF_OK;
  int rc = putIpcMsg(&queue, msg, &prc);
  free(msg);
  if (rc != 0)
    fprintf(trcOut(),
            "\nFunction '%s' call to 'HSVHIPCQueue::put' for path '%s.%s.IPC failed with HSVE "
            "reason '%s'.\n",
            "_trcSendIPCMsg", keyPart1, keyPart2, ecfErrorGetDescription(prc));
  return rc;
}
