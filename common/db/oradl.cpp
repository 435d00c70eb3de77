// The OCI library loader and its call wrappers.
#include "common/db/oradl.h"

#include <atomic>
#include <cstdio>
#include <cstring>
#include <mutex>

#include "common/msg/klplog.h"
#include "common/platform/hsv.h"
#include "common/trace/trace.h"

namespace {

constexpr int kTrcComp = 11;
constexpr int kFnInit = 168;
constexpr int kFnFirstWrapper = 169;
constexpr int kFnLastWrapper = 206;  // OCIStmtRelease; OCILobLocatorIsInit shares it

enum {
#define ORADL_INDEX(name, params, args) kFn_##name,
  ORADL_FUNCTIONS(ORADL_INDEX)
#undef ORADL_INDEX
};

const char* const kNames[] = {
#define ORADL_NAME(name, params, args) #name,
    ORADL_FUNCTIONS(ORADL_NAME)
#undef ORADL_NAME
};
static_assert(sizeof kNames / sizeof kNames[0] == ORADL::FUNCTION_COUNT, "OCI function table");

std::mutex gInitLock;                      // one load at a time
std::atomic<int> gLoaded{0};               // 1 once every function is resolved
std::atomic<int32_t> gQuiet{0};
std::atomic<void*> gSlots[ORADL::FUNCTION_COUNT];
char gLibName[1024] = "libclntsh.so";      // under gInitLock

// Never unloaded: resolved addresses stay valid for the life of the process.
// Built in static storage and never destroyed, so that no allocation can
// fail (a throwing one would end the caller's process) and no exit handler
// unloads it.
HSVSharedLib& ociLibrary() {
  alignas(HSVSharedLib) static unsigned char storage[sizeof(HSVSharedLib)];
  static HSVSharedLib* lib = ::new (storage) HSVSharedLib;
  return *lib;
}

bool quiet() { return gQuiet.load(std::memory_order_relaxed) != 0; }

void hexCode(char* out, size_t size, hsvRC rc) { snprintf(out, size, "0x%X", rc); }

template <int I, typename... A>
sword ociCall(A... args) {
  constexpr int fn = kFnFirstWrapper + I < kFnLastWrapper ? kFnFirstWrapper + I : kFnLastWrapper;
  trcEntry(kTrcComp, fn);
  if (gLoaded.load(std::memory_order_acquire) == 0) ORADL::OCIInit();
  if (void* slot = gSlots[I].load(std::memory_order_acquire)) {
    sword rc = reinterpret_cast<sword (*)(A...)>(slot)(args...);
    trcExit(kTrcComp, fn, TRC_RET_NONE);
    return rc;
  }
  if (!quiet()) {
    char origin[48];
    snprintf(origin, sizeof origin, "ORADL:%s", kNames[I]);
    logKlpMsg(660, origin, KLP_DEST_SEVERITY, kNames[I], nullptr, 0);
  }
  trcExit(kTrcComp, fn, TRC_RET_NONE);
  return ORADL::MISSING;
}

}  // namespace

int ORADL::OCIInit() {
  trcEntry(kTrcComp, kFnInit);
  std::lock_guard<std::mutex> guard(gInitLock);
  if (gLoaded.load() == 1) {
    trcExitRc(kTrcComp, kFnInit, 1);
    return 1;
  }
  HSVSharedLib& lib = ociLibrary();
  // A library that loaded but lacked a function is not loaded again: the
  // functions are looked up once more.
  if (!lib.isLoaded()) {
    hsvRC rc = lib.load(gLibName, 0);
    if (rc != ECF_OK) {
      if (!quiet()) {
        char code[16];
        hexCode(code, sizeof code, rc);
        logKlpMsg(657, "ORADL:OCIInit", KLP_DEST_SEVERITY, gLibName, nullptr, 2, code,
                  ecfErrorGetDescription(rc));
      }
      trcExitRc(kTrcComp, kFnInit, 0);
      return 0;
    }
    if (!quiet()) logKlpMsg(658, "ORADL:OCIInit", KLP_DEST_SEVERITY, gLibName, nullptr, 0);
  }
  int result = 1;
  for (int i = 0; i < FUNCTION_COUNT; ++i) {
    void* address = nullptr;
    hsvRC rc = lib.getFuncAddress(kNames[i], &address);
    if (rc != ECF_OK) {
      if (!quiet()) {
        char code[16];
        hexCode(code, sizeof code, rc);
        logKlpMsg(659, "ORADL:OCIInit", KLP_DEST_SEVERITY, kNames[i], nullptr, 2, code,
                  ecfErrorGetDescription(rc));
      }
      result = 0;
      break;
    }
    gSlots[i].store(address, std::memory_order_release);
  }
  gLoaded.store(result, std::memory_order_release);
  trcExitRc(kTrcComp, kFnInit, result);
  return result;
}

void ORADL::setQuiet(int32_t q) { gQuiet.store(q); }

void ORADL::setLibraryName(const char* name) {
  std::lock_guard<std::mutex> guard(gInitLock);
  snprintf(gLibName, sizeof gLibName, "%s", name && *name ? name : "libclntsh.so");
}

#define ORADL_DEFINE(name, params, args) \
  sword ORADL::name params { return ociCall<kFn_##name> args; }
ORADL_FUNCTIONS(ORADL_DEFINE)
#undef ORADL_DEFINE
