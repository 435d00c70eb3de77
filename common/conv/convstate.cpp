// The process-wide side of code-page conversion: ICU's converters opened once
// per CCSID (the master list), the clones handed to managers, and the
// recursive lock (stateGuard) under which both are touched.
#include <pthread.h>
#include <unicode/ucnv.h>
#include <unicode/ucnv_err.h>
#include <unicode/utypes.h>

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "common/conv/convmgr.h"
#include "common/conv/convstate.h"
#include "common/env/klpenv.h"
#include "common/msg/klplog.h"
#include "common/parms/klpparm.h"
#include "common/platform/hsv.h"
#include "common/trace/trace.h"
#include "common/util/klprc.h"

namespace {

constexpr int kTrcComp = 42;
constexpr int kFnOpen = 11;
constexpr int32_t kCloneSpace = 1024;

// One clone: the link, the clone itself (in `space` when ICU fitted it
// there, else on ICU's heap) and the space.
struct CloneBlock {
  CloneBlock* next;
  UConverter* clone;
  alignas(16) char space[kCloneSpace];
};

struct ConvState {
  pthread_mutex_t mutex = PTHREAD_MUTEX_INITIALIZER;
  std::atomic<uint64_t> owner{0};
  int32_t depth = 0;
  std::atomic<bool> initialized{true};  // set at process start, cleared by cleanup
  ConvListItem* masters = nullptr;
  CloneBlock* clones = nullptr;
};

ConvState gState;

void guardLock() {
  uint64_t self = hsvThreadID();
  if (gState.owner.load(std::memory_order_relaxed) == self) {
    ++gState.depth;
    return;
  }
  pthread_mutex_lock(&gState.mutex);
  gState.owner.store(self, std::memory_order_relaxed);
  gState.depth = 1;
}

// A release by a thread that does not own the lock leaves it as it is.
int guardUnlock() {
  if (gState.owner.load(std::memory_order_relaxed) != hsvThreadID()) {
    logInternalError("ConvMgr::stateGuard.unlock", KLP_RC_NOT_LOCK_OWNER, "unlock");
    return KLP_RC_NOT_LOCK_OWNER;
  }
  if (--gState.depth == 0) {
    gState.owner.store(0, std::memory_order_relaxed);
    pthread_mutex_unlock(&gState.mutex);
  }
  return 0;
}

// The CCSID whose ICU table serves a CCSID that needs a particular one;
// the CCSID itself otherwise. Every table is opened by number.
uint32_t tableFor(uint32_t ccsid) {
  switch (ccsid) {
    case 300: case 4396: return 16684;
    case 834: case 933: return 933;
    case 301: case 932: case 942: return 942;
    case 897: case 941: case 943: case 1351: case 5039: return 943;
    case 949: case 951: return 949;
    case 947: case 950: case 1114: return 950;
    case 954: return 33722;
    case 970: case 971: return 970;
    case 1362: case 1363: return 1363;
    case 1370: case 1373: return 1373;  // its only table, version "_P100-2002"
    case 1380: case 1381: return 1381;
    case 1382: case 1383: return 1383;
    case 1385: case 1386: return 1386;
    default: return ccsid;
  }
}

}  // namespace

void convReportIcu(const char* origin, const char* function, uint32_t ccsid, int icuError) {
  char ccsidText[16], errText[16];
  snprintf(ccsidText, sizeof ccsidText, "%d", static_cast<int>(ccsid));
  snprintf(errText, sizeof errText, "%d", icuError);
  logKlpMsg(568, origin, KLP_DEST_SEVERITY, "*", nullptr, 5, function, ccsidText, errText, "*",
            u_errorName(static_cast<UErrorCode>(icuError)));
}

bool convStrictApply() {
  // The apply server with its boolean parameter 39 set decides about every
  // conversion error itself.
  return convParmBool("xqapply", 39);
}

int ConvMgr::openConverter(uint32_t ccsid, UConverter** conv, int encoding) {
  trcEntry(kTrcComp, kFnOpen);
  if (trcIsRunning()) {
    char inputs[64];
    snprintf(inputs, sizeof inputs, "ccsid: %d, encoding: %d", static_cast<int>(ccsid), encoding);
    trcData(kTrcComp, kFnOpen, "inputs", 2, 7, static_cast<uint32_t>(strlen(inputs)), inputs);
  }
  UErrorCode err = U_ZERO_ERROR;
  *conv = nullptr;
  if (ccsid == 864) {
    *conv = ucnv_open("crv-864_X120-2012", &err);
    if (U_FAILURE(err)) {
      err = U_ZERO_ERROR;
    } else {
      logKlpMsg(-1, "ConvMgr::openConverter", KLP_DEST_SEVERITY,
                "Custom convertor for 864(\"crv-864_X120-2012\") found and will be used instead "
                "of the default.", nullptr, 0);
    }
  }
  if (!*conv) {
    *conv = ucnv_openCCSID(static_cast<int32_t>(tableFor(ccsid)), kCcsidPlatform, &err);
  }
  trcData(kTrcComp, kFnOpen, "ICU return code", 2, 0, 4, &err);
  int rc = 0;
  if (U_FAILURE(err) || !*conv) {
    if (*conv) ucnv_close(*conv);
    *conv = nullptr;
    convReportIcu("ConvMgr::openConverter", "ucnv_open", ccsid,
              U_FAILURE(err) ? err : U_MISSING_RESOURCE_ERROR);
    rc = CONV_RC_ICU;
  } else if (convStrictApply()) {
    UErrorCode e = U_ZERO_ERROR;
    ucnv_setToUCallBack(*conv, UCNV_TO_U_CALLBACK_STOP, nullptr, nullptr, nullptr, &e);
    ucnv_setFromUCallBack(*conv, UCNV_FROM_U_CALLBACK_STOP, nullptr, nullptr, nullptr, &e);
  }
  trcExitRc(kTrcComp, kFnOpen, rc);
  return rc;
}

int ConvMgr::getConverter(uint32_t ccsid, UConverter** clone, int /*encoding*/) {
  *clone = nullptr;
  guardLock();
  int rc = 0;
  ConvListItem* master = nullptr;
  if (!gState.initialized.load()) {
    logKlpMsg(569, "ConvMgr::getConverter", KLP_DEST_SEVERITY, "static ConvMgr not initialized",
              nullptr, 0);
    rc = CONV_RC_NO_STATE;
  }
  for (ConvListItem* m = gState.masters; rc == 0 && m; m = m->next)
    if (m->ccsid == ccsid) master = m;
  if (rc == 0 && !master) {
    master = static_cast<ConvListItem*>(calloc(1, sizeof(ConvListItem)));
    if (!master) {
      logKlpMsg(543, "ConvMgr::getConverter", KLP_DEST_SEVERITY, "24", nullptr, 1, "ConvListItem");
      rc = KLP_RC_NO_MEMORY;
    } else if ((rc = openConverter(ccsid, &master->conv, 0)) != 0) {
      free(master);
      master = nullptr;
    } else {
      master->ccsid = ccsid;
      master->next = gState.masters;
      gState.masters = master;
    }
  }
  if (rc == 0) {
    CloneBlock* block = static_cast<CloneBlock*>(malloc(sizeof(CloneBlock)));
    if (!block) {
      char size[16];
      snprintf(size, sizeof size, "%d", static_cast<int>(sizeof(CloneBlock)));
      logKlpMsg(543, "ConvMgr::getConverter", KLP_DEST_SEVERITY, size, nullptr, 1, "clone block");
      rc = KLP_RC_NO_MEMORY;
    } else {
      UErrorCode err = U_ZERO_ERROR;
      int32_t size = kCloneSpace;
      // The clone goes into our own block so that the clone chain owns it;
      // the newer clone call cannot place it there.
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wdeprecated-declarations"
      block->clone = ucnv_safeClone(master->conv, block->space, &size, &err);
#pragma GCC diagnostic pop
      if (U_FAILURE(err)) {
        convReportIcu("ConvMgr::getConverter", "ucnv_safeClone", ccsid, err);
        if (block->clone) ucnv_close(block->clone);
        rc = CONV_RC_ICU;
      } else if (!block->clone) {
        logKlpMsg(569, "ConvMgr::getConverter", KLP_DEST_SEVERITY, "no clone returned by ICU !!",
                  nullptr, 0);
        rc = CONV_RC_NO_STATE;
      }
      if (rc != 0) {
        free(block);
      } else {
        block->next = gState.clones;
        gState.clones = block;
        *clone = block->clone;
      }
    }
  }
  int unlockRc = guardUnlock();
  return rc != 0 ? rc : unlockRc;
}

bool convStateAlive() { return gState.initialized.load(std::memory_order_acquire); }

void convReleaseClone(UConverter* clone) {
  if (!clone) return;
  guardLock();
  for (CloneBlock** p = &gState.clones; *p; p = &(*p)->next) {
    if ((*p)->clone != clone) continue;
    CloneBlock* block = *p;
    *p = block->next;
    ucnv_close(block->clone);
    free(block);
    break;
  }
  guardUnlock();
}

void ConvMgr::cleanup() {
  guardLock();
  while (ConvListItem* m = gState.masters) {
    gState.masters = m->next;
    ucnv_close(m->conv);
    free(m);
  }
  while (CloneBlock* b = gState.clones) {
    gState.clones = b->next;
    ucnv_close(b->clone);
    free(b);
  }
  gState.initialized.store(false, std::memory_order_release);
  guardUnlock();
}

bool convParmBool(const char* program, int index) {
  if (program && strcmp(getEnvProgramName(klpGetEnv()), program) != 0) return false;
  const klpParmClass* parms = klpGetCurrentParms();
  const ParmEntry* slot = parms ? parms->peekSlot(index) : nullptr;
  return slot && slot->type == PARM_BOOLEAN && slot->boolValue != 0;
}
