// The exported control interface: C entry points of the shared library for
// programs that stop a server or read its status without the console.
#include "include/klpapi.h"

#include <cstdlib>
#include <cstring>

#include "common/env/klpenv.h"
#include "common/ipc/cmdapi.h"
#include "common/ipc/ipcmsg.h"
#include "common/thread/recoverymgr.h"

namespace {

int store(klpResultBlock* result, int rc) {
  result->rc = static_cast<int16_t>(rc);
  return rc;
}

int missing(klpResultBlock* result, const char* what) {
  std::memset(result->text, 0, sizeof(result->text));
  std::strncpy(result->text, what, sizeof(result->text) - 1);
  return store(result, KLP_API_MISSING_ARG);
}

bool emptyName(const char* name) { return !name || name[0] == '\0' || name[0] == ' '; }

void copyCaptured(klpResultBlock* result, const klpMsgCapture& cap) {
  size_t n = strnlen(cap.text, sizeof(cap.text));
  if (n > sizeof(result->text) - 1) n = sizeof(result->text) - 1;
  std::memcpy(result->text, cap.text, n);
  result->text[n] = '\0';
}

// A call ended by a signal: its clean-ups ran; the caller gets 2010 and the
// signal report as text.
int interrupted(klpResultBlock* result, erLibraryCall& call) {
  char text[sizeof(result->text)];
  int rc = call.recover(text, sizeof(text));
  if (!result) return rc;
  std::memcpy(result->text, text, sizeof(text));
  return store(result, rc);
}

}  // namespace

// Every exported call runs with our signal handling and gives the caller's
// back before it returns; a signal during the call ends the call, never the
// caller's process.
#define KLP_GUARD_CALL(result)             \
  erLibraryCall guard_;                    \
  if (KLP_SET_CALL_POINT(guard_) != 0) return interrupted(result, guard_)

extern "C" {

KLP_API int klpStartProgram(void) { return 0; }

KLP_API int klpStopProgram(int32_t kind, const char* serverName, const char* schema,
                           int32_t option, klpResultBlock* result) {
  KLP_GUARD_CALL(result);
  if (!result) return KLP_API_MISSING_ARG;
  if (kind < KLP_KIND_APP || kind > KLP_KIND_MON) return store(result, KLP_API_BAD_KIND);
  if (emptyName(serverName)) return store(result, KLP_API_NO_SERVER);
  if (emptyName(schema)) return store(result, KLP_API_NO_SCHEMA);
  if (option < 0) return store(result, KLP_API_NEGATIVE_OPTION);
  char name[KLP_UNIQUE_NAME_SIZE];
  int rc = klpBuildServerName(kind, serverName, schema, name, sizeof(name));
  if (rc != 0) return store(result, rc);
  klpEnsureMainThread();

  std::memset(result, 0, sizeof(*result));
  klpMsgCapture cap;
  std::memset(&cap, 0, sizeof(cap));
  char* reply = nullptr;
  rc = cmdAPIFunc(name, IPC_FUNC_STOP, nullptr, &reply, &cap);
  std::free(reply);
  if (rc != 0) {
    copyCaptured(result, cap);
    rc = klpMapCmdRc(rc);
  }
  return store(result, rc);
}

KLP_API int klpGetStatusSize(const klpReleaseInfo* release, klpStatusRequest* request,
                             klpResultBlock* result) {
  KLP_GUARD_CALL(result);
  if (!result) return KLP_API_MISSING_ARG;
  if (!release) return missing(result, "klpReleaseInfo");
  if (!request) return missing(result, "klpGetStatusDataSize");
  if (release->version != KLP_API_VERSION || release->release != KLP_API_RELEASE ||
      release->modification != KLP_API_MODIFICATION)
    return store(result, KLP_API_BAD_RELEASE);
  int32_t kind = release->kind;
  if (kind < KLP_KIND_APP || kind > KLP_KIND_MON) return store(result, KLP_API_BAD_KIND);
  if (kind == KLP_KIND_KCAP) {
    request->statusSize = KLP_STATUS_FMT3_SIZE;
    return store(result, 0);
  }
  char name[KLP_UNIQUE_NAME_SIZE];
  int rc = klpBuildServerName(kind, request->serverName, request->schema, name, sizeof(name));
  if (rc != 0) return store(result, rc);
  klpEnsureMainThread();

  std::memset(result, 0, sizeof(*result));
  klpMsgCapture cap;
  std::memset(&cap, 0, sizeof(cap));
  char* reply = nullptr;
  int func = kind == KLP_KIND_KAPP ? IPC_FUNC_KAPP_SIZE : IPC_FUNC_STATUS_SIZE;
  rc = cmdAPIFunc(name, func, nullptr, &reply, &cap);
  if (rc != 0) {
    std::free(reply);
    copyCaptured(result, cap);
    return store(result, klpMapCmdRc(rc));
  }
  int32_t size = 0;
  rc = klpStatusSizeFromReply(kind, reply, &size, &cap);
  std::free(reply);
  if (rc != 0) {
    copyCaptured(result, cap);
    return store(result, rc);
  }
  request->statusSize = size;
  return store(result, 0);
}

KLP_API int klpGetStatus(const klpReleaseInfo* release, klpStatusRequest* request,
                         klpResultBlock* result) {
  KLP_GUARD_CALL(result);
  if (!result) return KLP_API_MISSING_ARG;
  if (!release) return missing(result, "klpReleaseInfo");
  if (!request) return missing(result, "klpGetStatusData");
  if (!request->buffer) return store(result, KLP_API_NO_BUFFER);
  // A negative capacity is as unusable as none.
  if (request->bufferSize <= 0) return store(result, KLP_API_BUFFER_SIZE_ZERO);
  klpMsgCapture cap;
  std::memset(&cap, 0, sizeof(cap));
  return klpCollectStatus(release, request, result, &cap);
}

}  // extern "C"
