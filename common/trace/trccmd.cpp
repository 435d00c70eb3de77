// The trace control command behind the exported entry point _klpTrace: the
// run of one argument vector, from the output file and the keys to the one
// action it asks for and the filter change that may follow.
#include <strings.h>

#include <cctype>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <mutex>

#include "common/env/klpenv.h"
#include "common/platform/hsv.h"
#include "common/trace/trace_anchor.h"
#include "common/trace/trc_internal.h"
#include "common/trace/trcformat.h"
#include "common/trace/trcopts.h"
#include "common/trace/trcread.h"
#include "common/trace/trcreport.h"
#include "common/trace/trcwrite.h"
#include "include/klptrc.h"

namespace {

constexpr uint32_t kOnWaitMs = 500;
constexpr uint32_t kKillWaitMs = 2000;
constexpr const char* kKeeper = "klptrcbp";

// One command runs at a time in a process: they share the anchor.
std::mutex g_commandLock;
// The anchor was initialised by this entry point, not by a server's main
// routine: every call of the process is a standalone one.
bool g_anchorOurs = false;

struct Run {
  trcOptions o;
  trcAnchor* anchor;
  bool standalone;
  char keyPart2[TRC_KEY_SIZE];  // built from the options; key part 1 is the anchor's
  bool formatted;  // the -d and -df were used up by formatting
};

void upper(const char* in, char* out, size_t size) {
  size_t i = 0;
  for (; in[i] != '\0' && i + 1 < size; ++i)
    out[i] = static_cast<char>(toupper(static_cast<unsigned char>(in[i])));
  out[i] = '\0';
}

// Opens the -ofn file for appending as the anchor's output stream; on any
// failure output stays where it was.
void openOutputFile(Run* r) {
  trcAnchor* a = r->anchor;
  if (a->out != nullptr) {
    fclose(a->out);
    a->out = nullptr;
  }
  const char* name = r->o.outFileName;
  FILE* f = fopen(name, "r+");
  if (f == nullptr) {
    FILE* created = fopen(name, "a");
    if (created == nullptr) {
      printf("Unable to create file \"%s\", error:  \"%s\"\n", name, strerror(errno));
      return;
    }
    fclose(created);
    f = fopen(name, "r+");
    if (f == nullptr) {
      printf("Unable to open file \"%s' with mode \"r+\", error:  \"%s\"\n", name,
             strerror(errno));
      return;
    }
  }
  if (fseek(f, 0, SEEK_END) != 0)
    printf("Unable to change file position to end of file \"%s\",\nfseek() error:  \"%d\", "
           "reason:  \"%s\".\n", name, errno, strerror(errno));
  a->out = f;
}

// Lets go of the block this process holds: detaches (or destroys), and the
// anchor forgets it.
void dropBlock(trcAnchor* a, bool destroy) {
  trcDropBlock(destroy);
  __atomic_store_n(&a->state, TRC_STATE_STOPPED, __ATOMIC_SEQ_CST);
}

// Attaches to the block of the keys when there is one. False when the
// command is over: a block that is there but cannot be attached (nothing
// the command would go on to say about it would be true), or one of an
// incompatible version.
bool attachBlock(Run* r) {
  trcAnchor* a = r->anchor;
  if (a->block != nullptr) return true;
  HSVHIPCMemory* memory = nullptr;
  trcBlockHeader* block = nullptr;
  hsvRC rc = trcOpenBlock(a->keyPart1, r->keyPart2, &memory, &block);
  if (rc == ECF_NOT_FOUND) return true;
  if (rc != ECF_OK) {
    char* key = trcKeyText(a->keyPart1, r->keyPart2);
    fprintf(trcOut(), "Function 'HSVHIPCMemory::attach' with IPC key '%s' failed with HSVE reason "
            "'%s'.\n", key != nullptr ? key : "UNKNOWN", ecfErrorGetDescription(rc));
    free(key);
    return false;
  }
  a->memory = memory;
  trcint::publishBlock(block, memory->getSize());
  trcCopyKey(a->keyPart2, r->keyPart2);
  if (block->status == TRC_STATE_RUNNING) {
    if (!trcCheckVersion(block, nullptr, false)) {
      fputs("Unable to attach to trace\n", trcOut());
      trcCheckVersion(block, nullptr, true);
      dropBlock(a, false);
      return false;
    }
    trcStartTracing(block);
  } else if (!r->standalone) {
    // A server leaves a block that is not running as its detach would.
    trcDetach();
  }
  return true;
}

void turnOn(Run* r) {
  trcAnchor* a = r->anchor;
  FILE* out = trcOut();
  const trcOptions& o = r->o;
  int rc = trcCreate(o.bufferSize, a->keyPart1, r->keyPart2, o.fileName, o.maxFileSize,
                     o.logLevel, r->standalone);
  char* key = trcKeyText(a->keyPart1, r->keyPart2);
  if (rc != 0) {
    fprintf(out, "Trace failed to start with return code %d.\n", rc);
    fprintf(out, "Key token was '%s'\n", r->keyPart2);
    fprintf(out, "IPC key was   '%s'\n", key != nullptr ? key : "UNKNOWN");
    free(key);
    return;
  }
  if (key != nullptr)
    fprintf(out, "Trace is turned on, with IPC key '%s'\n", key);
  else
    fputs("Trace is turned on, but an error occurred retrieving IPC key.\n", out);
  free(key);
  // The keeper starts the process that holds the block and ends at once.
  const char* argv[] = {kKeeper, a->keyPart1, r->keyPart2, nullptr};
  int32_t pid = 0;
  int exitCode = -1;
  if (hsvStartProcess(kKeeper, argv, &pid) != ECF_OK || hsvWaitProcess(pid, &exitCode) != ECF_OK ||
      exitCode != 0)
    fputs("Create Process failed!!\n", out);
}

void turnOff(Run* r) {
  trcAnchor* a = r->anchor;
  FILE* out = trcOut();
  trcBlockHeader* block = a->block;
  if (block == nullptr) {
    fputs("Trace is already off, no action taken.\n", out);
    return;
  }
  trcLockBuffer(block);
  block->status = TRC_STATE_STOP;
  trcUnlockBuffer(block);
  fputs("Trace is turned off.\n", out);
  if (block->fileName[0] != '\0') trcFlushLastLap(block);
  if (block->appAttached == 0) {
    trcFree();
  } else if (r->standalone) {
    fprintf(out,
            "Unable to free the trace buffer at this time.\nThe \"%s\" application will free "
            "the trace buffer while it is running or when it is restarted.\nUse the klptrc "
            "\"kill\" option to free the trace buffer, if the \"%s\" application is stopped.\n",
            r->o.kind, r->o.kind);
  }
}

void killTrace(Run* r) {
  trcAnchor* a = r->anchor;
  if (a->block == nullptr) {
    fputs("Trace is already off, no action taken.\n", trcOut());
    return;
  }
  fputs("Forcing trace off...\n", trcOut());
  a->block->status = TRC_STATE_STOP;
  hsvSleep(kKillWaitMs);
  trcFree();
}

void clearTrace(trcBlockHeader* block) {
  trcLockBuffer(block);
  block->writeOffset = block->oldestOffset = block->highWaterOffset = block->entryCount = 0;
  trcUnlockBuffer(block);
}

void dumpTrace(Run* r) {
  trcAnchor* a = r->anchor;
  FILE* out = trcOut();
  trcBlockHeader* block = a->block;
  const char* dump = r->o.fileName;
  if (block == nullptr) {
    fputs("Trace is not turned on.\n", out);
    return;
  }
  if (strncmp(dump, block->fileName, sizeof block->fileName) == 0) {
    fprintf(out, "Already tracing directly to file \"%s\"\n", dump);
    return;
  }
  size_t size = a->memory->getSize();
  trcLockBuffer(block);
  trcBlockHeader* copy = static_cast<trcBlockHeader*>(malloc(size));
  if (copy != nullptr) {
    memcpy(copy, block, size);
    memset(copy->fileName, 0, sizeof copy->fileName);
    strncpy(copy->fileName, dump, sizeof copy->fileName - 1);
    trcLockFile(block);
    trcUnlockBuffer(block);
    remove(dump);
    trcFlushToFile(copy, true);
    trcUnlockFile(block);
    free(copy);
    return;
  }
  if (r->o.holdlock) {
    char own[sizeof block->fileName];
    memcpy(own, block->fileName, sizeof own);
    memset(block->fileName, 0, sizeof block->fileName);
    strncpy(block->fileName, dump, sizeof block->fileName - 1);
    trcLockFile(block);
    remove(dump);
    trcFlushToFile(block, true);
    trcUnlockFile(block);
    memcpy(block->fileName, own, sizeof own);
  }
  trcUnlockBuffer(block);
}

// Runs the first action that applies.
void runAction(Run* r) {
  trcAnchor* a = r->anchor;
  const trcOptions& o = r->o;
  FILE* out = trcOut();
  if (o.resetlock) {
    if (a->block == nullptr) {
      fputs("Trace is not on.\n", out);
      return;
    }
    hsvByteLockRelease(&a->block->bufferLock);
    hsvByteLockRelease(&a->block->fileLock);
  } else if (o.on) {
    if (a->block == nullptr ||
        (a->block->status != TRC_STATE_STARTING && a->block->status != TRC_STATE_RUNNING)) {
      turnOn(r);
      hsvSleep(kOnWaitMs);
    } else {
      fputs("Trace is already on, no action taken.\n", out);
    }
    if (r->standalone) _trcSendIPCMsg(a->keyPart1, r->keyPart2, 10);
  } else if (o.off) {
    turnOff(r);
  } else if (o.kill) {
    killTrace(r);
  } else if (o.clr) {
    if (a->block != nullptr) clearTrace(a->block);
  } else if (o.flw || o.fmt || o.v7fmt || o.json) {
    trcFormatCommand(&o);
    r->formatted = true;
  } else if (o.stat || o.statlong || o.statg) {
    trcStatusReport(&o);
  } else if (o.diag) {
    trcDiagReport();
  } else if (o.dmp) {
    dumpTrace(r);
  }
}

// Checks the keys and the combination of subcommands; false (reported) when
// the command cannot run.
bool checkKeys(Run* r) {
  trcOptions& o = r->o;
  FILE* out = trcOut();
  bool readsTrace = o.flw || o.fmt || o.v7fmt || o.stat || o.statlong || o.statg || o.json;
  if (o.dbName == nullptr || o.kind == nullptr) {
    if (!readsTrace) {
      fputs("database name and application specifier are required.\n", out);
      o.error = true;
    } else if (o.fileName == nullptr) {
      fputs("either database name and application specifier\n", out);
      fputs("or filename are required.\n", out);
      o.error = true;
    }
  }
  if (o.json && (o.flw || o.fmt || o.v7fmt)) {
    fputs("Error: \"json\" cannot be combined with \"flw\", \"fmt\" or \"v7fmt\".\n", out);
    o.error = true;
  }
  if (!o.error && o.dbName != nullptr && o.kind != nullptr) {
    char db[KLP_UNIQUE_NAME_SIZE], schema[KLP_UNIQUE_NAME_SIZE];
    upper(o.dbName, db, sizeof db);
    upper(o.schema, schema, sizeof schema);
    if (klpBuildNamePrefix(r->keyPart2, sizeof r->keyPart2, db, schema, o.kind) != 0 ||
        strlen(o.dbName) >= sizeof db || strlen(o.schema) >= sizeof schema) {
      fprintf(out, "Error: The name \"%s.%s.%s\" is longer than %d characters.\n", o.dbName,
              o.schema, o.kind, (int)KLP_UNIQUE_NAME_SIZE - 1);
      o.error = true;
    }
  }
  if (o.error) fputs("Try 'klptrc -help' for usage instructions\n", out);
  return !o.error;
}

void run(Run* r) {
  trcAnchor* a = r->anchor;
  trcOptions& o = r->o;
  trcCopyKey(a->keyPart1, getEnvIPCDir(klpGetEnv()));
  if (o.outFileName != nullptr) openOutputFile(r);
  if (o.help) return trcUsage();
  if (o.listsymbols) return trcListSymbols();
  if (!checkKeys(r)) return;
  if (o.dbName != nullptr && o.kind != nullptr) {
    if (!attachBlock(r)) return;
    if (a->block == nullptr && !o.on && !o.off && !o.kill) {
      fputs("Trace is not on.\n", trcOut());
      return;
    }
  }
  runAction(r);
  if ((o.levelGiven || o.filterCount > 0) && !r->formatted && a->block != nullptr) {
    if (o.levelGiven) a->block->globalFilter = o.logLevel;
    trcApplyFilters(a->block, o.filters, o.filterCount);
  }
}

}  // namespace

extern "C" KLPTRC_API int _klpTrace(int argc, char** argv) {
  std::lock_guard<std::mutex> hold(g_commandLock);
  bool standalone = g_anchorOurs || trcGetAnchor() == nullptr;
  if (trcGetAnchor() == nullptr) {
    trcInitAnchor();
    g_anchorOurs = true;
  }
  Run* r = static_cast<Run*>(calloc(1, sizeof(Run)));
  if (r == nullptr) {
    fputs("Out of memory.\n", trcOut());
    return 0;
  }
  r->anchor = trcGetAnchor();
  r->standalone = standalone;
  trcParseArgs(argc, argv, &r->o);
  if (standalone) hsvOneTimeOnly();
  run(r);
  trcAnchor* a = r->anchor;
  if (standalone && a->block != nullptr) dropBlock(a, false);
  if (a->out != nullptr) {
    fclose(a->out);
    a->out = nullptr;
  }
  fflush(stdout);
  trcFreeOptions(&r->o);
  free(r);
  return 0;
}
