#include "common/trace/trcreport.h"

#include <cstdlib>
#include <cstring>

#include "common/trace/trace_anchor.h"
#include "common/trace/trcformat.h"
#include "common/trace/trcread.h"
#include "common/trace/trcsymbols.h"

namespace {

// Bytes of the data area in use, header included.
uint32_t bufferUsed(const trcBlockHeader* h) {
  uint32_t data = h->oldestOffset < h->writeOffset
                      ? h->writeOffset - h->oldestOffset
                      : h->writeOffset + h->highWaterOffset - h->oldestOffset;
  return h->dataOffset + data;
}

void printModules(FILE* out, const trcBlockHeader* h) {
  if (h->moduleCount == 0) {
    fputs("Module-level version information not available.\n", out);
    return;
  }
  fputs("Module-level version information:\n  name           apar      compiled\n", out);
  // A count beyond the table's 36 entries comes from a damaged header.
  int count = h->moduleCount < TRC_MODULES ? h->moduleCount : TRC_MODULES;
  for (int i = 0; i < count; ++i) {
    const klpModuleRecord& m = h->modules[i];
    fprintf(out, "  %-15.*s%-10.*s%.*s\n", (int)sizeof m.name, m.name, (int)sizeof m.fixLevel,
            m.fixLevel, (int)sizeof m.compileStamp, m.compileStamp);
  }
}

}  // namespace

void trcStatusReport(const trcOptions* o) {
  FILE* out = trcOut();
  trcBlockHeader* h = static_cast<trcBlockHeader*>(malloc(sizeof(trcBlockHeader)));
  if (h == nullptr) {
    fputs("Unable to allocate storage for local copy of trace control block for status.\n", out);
    return;
  }
  char level[16];
  const char* status;
  uint32_t size;
  if (o->fileName == nullptr) {
    trcAnchor* anchor = trcGetAnchor();
    if (anchor == nullptr || anchor->block == nullptr) {
      fputs("Trace is not turned on.\n", out);
      free(h);
      return;
    }
    char* key = trcKeyText(anchor->keyPart1, anchor->keyPart2);
    if (key != nullptr)
      fprintf(out, "Trace status from buffer with IPC key '%s'\n", key);
    else
      fputs("Trace status from buffer; unable to retrieve IPC key.\n", out);
    free(key);
    trcLockBuffer(anchor->block);
    memcpy(h, anchor->block, sizeof *h);
    trcUnlockBuffer(anchor->block);
    trcLevelText(h->globalFilter, level);
    status = trcStatusText(h->status);
    size = h->bufferSize;
  } else {
    fprintf(out, "Trace status from file '%s'\n", o->fileName);
    int rc = trcReadFileHeader(o->fileName, h);
    if (rc == TRC_READ_NO_FILE) fprintf(out, "Unable to open file \"%s\"\n", o->fileName);
    if (rc == TRC_READ_SHORT) printf("Unable to read header from file \"%s\"\n", o->fileName);
    if (rc != TRC_READ_OK || !trcCheckVersion(h, o->fileName, true)) {
      free(h);
      return;
    }
    strcpy(level, "N/A");
    status = "N/A";
    size = h->highWaterOffset;
  }
  trcPrintVersionInfo(out, h);
  fprintf(out, "Num Entries: %d\n", (int)h->entryCount);
  fprintf(out, "Buffer Size: %d\n", (int)size);
  fprintf(out, "Buffer Used: %d\n", (int)bufferUsed(h));
  fprintf(out, "LogDiagLvl : %s\n", level);
  fprintf(out, "Status:      %s\n", status);
  if (o->statlong) printModules(out, h);
  free(h);
}

void trcDiagReport() {
  FILE* out = trcOut();
  trcAnchor* anchor = trcGetAnchor();
  if (anchor == nullptr || anchor->block == nullptr) {
    fputs("Trace is not turned on.\n", out);
    return;
  }
  fputs("\nDiag Settings", out);
  fputs("\n=============\n", out);
  uint16_t global;
  uint16_t component[TRC_COMPONENTS];
  uint16_t(*function)[TRC_FUNCTIONS] =
      static_cast<uint16_t(*)[TRC_FUNCTIONS]>(malloc(sizeof anchor->block->functionFilters));
  if (function == nullptr) {
    fputs("Out of memory.\n", out);
    return;
  }
  trcLockBuffer(anchor->block);
  global = anchor->block->globalFilter;
  memcpy(component, anchor->block->componentFilters, sizeof component);
  memcpy(function, anchor->block->functionFilters, sizeof anchor->block->functionFilters);
  trcUnlockBuffer(anchor->block);
  char level[16];
  trcLevelText(global & TRC_FILTER_LEVELS, level);
  fprintf(out, "Global filter = %s\n", level);
  for (int c = 0; c < TRC_COMPONENTS; ++c) {
    bool named = false;
    if (component[c] & TRC_FILTER_OVERRIDE) {
      trcLevelText(component[c] & TRC_FILTER_LEVELS, level);
      fprintf(out, "Component: \"%s\" = %s\n", trcComponentName(c), level);
      named = true;
    }
    for (int f = 0; f < TRC_FUNCTIONS; ++f) {
      if (!(function[c][f] & TRC_FILTER_OVERRIDE)) continue;
      if (!named) fprintf(out, "Component: \"%s\"\n", trcComponentName(c));
      named = true;
      const char* row = trcFunctionRow(c, f);
      trcLevelText(function[c][f] & TRC_FILTER_LEVELS, level);
      fprintf(out, " Function: \"%s\" = %s\n", row != nullptr && row[0] ? row : "UNKNOWN FUNCTION",
              level);
    }
  }
  fputs("\n", out);
  free(function);
}

void trcListSymbols() {
  FILE* out = trcOut();
  fputs("\nComponent and Function names suitable for \"-df\" option:", out);
  fputs("\n=========================================================\n", out);
  for (int c = 0; c < TRC_COMPONENTS; ++c) {
    const char* name = trcComponentName(c);
    if (name[0] == '\0') continue;
    fprintf(out, "\nComponent: \"%s\"\n  Functions:\n", name);
    for (int f = 0; f < trcFunctionRows(c); ++f) {
      const char* row = trcFunctionRow(c, f);
      if (row[0] == '\0' || strcmp(row, "ZERO_PLACE_HOLDER") == 0) continue;
      fprintf(out, "  \"%s\"\n", row);
    }
  }
  fputs("\n", out);
}

void trcUsage() {
  FILE* out = trcOut();
  fprintf(out, "klptrc  %d.%d.%d (platform: %s; format: %s/%s)\n", TRC_VERSION, TRC_RELEASE,
          TRC_MODIFICATION, TRC_PLATFORM, TRC_STRUCT_VERSION, TRC_SYMBOL_VERSION);
  fputs(
      "K Capture tracing utility: switches a server's shared-memory trace on and off,\n"
      "dumps, formats and reports it.\n"
      "\n"
      "Help and symbols:\n"
      "  klptrc -help\n"
      "  klptrc -listsymbols\n"
      "\n"
      "Turn a trace on, off (normal end) or kill it (abnormal end, forces termination):\n"
      "  klptrc on  <keys> [-b size] [-fn file [-fs size]] [-d levels] [-df name levels]...\n"
      "             [-ofn outfile]\n"
      "  klptrc off <keys>\n"
      "  klptrc kill <keys>\n"
      "Clear the buffer:\n"
      "  klptrc clr <keys>\n"
      "Dump the buffer to a file:\n"
      "  klptrc dmp dumpfile <keys> [-holdlock]\n"
      "Format a buffer, or a trace or dump file:\n"
      "  klptrc flw|fmt|v7fmt <keys> [-d levels] [-holdlock] [-hex] [-df name levels]...\n"
      "  klptrc flw|fmt|v7fmt -fn file [-d levels] [-hex] [-df name levels]...\n"
      "Change the filter settings while a trace is running:\n"
      "  klptrc <keys> [-d levels] [-df name levels]...\n"
      "Show the filter settings:\n"
      "  klptrc diag <keys>\n"
      "Show status and version information, from a buffer or a file:\n"
      "  klptrc stat <keys>          klptrc stat -fn file\n"
      "  klptrc statlong <keys>      klptrc statlong -fn file\n"
      "Unlock a trace when an abnormal termination has 'leaked' its lock:\n"
      "  klptrc resetlock <keys>\n"
      "\n"
      "<keys> are the keys of the shared memory buffer: -db name (or -subsystem name) and\n"
      "a server kind: -cap, -app, -kcap, -kapp (the \"k\" options are the message-queuing\n"
      "based servers) or -mon (the monitor); -schema name or -qualifier name overrides\n"
      "the default schema \"KLP\". Formatting and status may name a file with -fn instead.\n"
      "\n"
      "Levels: -d sets the global filter; any number of -df set component or function\n"
      "filters, so that levels turned off globally may be turned back on for components\n"
      "or functions (-listsymbols lists the names). A level list is digits 1 to 6\n"
      "separated by commas: 1 entry/exit, 2 basic data, 3 detailed data,\n"
      "4 performance data, 5 SQL statement data, 6 message-queuing (XQ) data.\n"
      "\n"
      "Styles: \"flw\" is a summary indented by call depth per process and thread; \"fmt\"\n"
      "lists every record in time order with whole data structures (in hexadecimal with\n"
      "-hex); \"v7fmt\" is the version-7 style for Apply traces.\n"
      "\n"
      "Output goes to standard output unless -ofn names a file (an absolute path), which\n"
      "is appended to when it exists.\n"
      "Trace-event JSON for Perfetto or chrome://tracing: klptrc json [-fn file | <keys>]"
      " [-ofn outfile]\n",
      out);
}
