#include "common/trace/trcopts.h"

#include <strings.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "common/trace/trcread.h"
#include "common/trace/trcsymbols.h"

namespace {

// What a keyword does with the options record.
enum Action {
  A_FLAG,      // sets one flag
  A_KIND,      // server kind
  A_DUMP,      // dmp and its file name
  A_FILE,      // -fn
  A_OUTFILE,   // -ofn
  A_BUFSIZE,   // -b
  A_FILESIZE,  // -fs
  A_LOGLEVEL,  // -d
  A_OUTLEVEL,  // -o
  A_DB,        // -db, -subsystem
  A_SCHEMA,    // -schema, -qualifier
  A_FILTER,    // -df
};

struct Keyword {
  const char* word;
  Action action;
  bool trcOptions::*flag;  // A_FLAG
  const char* kind;        // A_KIND
};

constexpr Keyword kKeywords[] = {
    {"on", A_FLAG, &trcOptions::on, nullptr},
    {"off", A_FLAG, &trcOptions::off, nullptr},
    {"kill", A_FLAG, &trcOptions::kill, nullptr},
    {"clr", A_FLAG, &trcOptions::clr, nullptr},
    {"resetlock", A_FLAG, &trcOptions::resetlock, nullptr},
    {"-holdlock", A_FLAG, &trcOptions::holdlock, nullptr},
    {"flw", A_FLAG, &trcOptions::flw, nullptr},
    {"fmt", A_FLAG, &trcOptions::fmt, nullptr},
    {"v7fmt", A_FLAG, &trcOptions::v7fmt, nullptr},
    {"stat", A_FLAG, &trcOptions::stat, nullptr},
    {"statlong", A_FLAG, &trcOptions::statlong, nullptr},
    {"statg", A_FLAG, &trcOptions::statg, nullptr},
    {"diag", A_FLAG, &trcOptions::diag, nullptr},
    {"-listsymbols", A_FLAG, &trcOptions::listsymbols, nullptr},
    {"-hex", A_FLAG, &trcOptions::hex, nullptr},
    {"-help", A_FLAG, &trcOptions::help, nullptr},
    {"json", A_FLAG, &trcOptions::json, nullptr},
    {"-cap", A_KIND, nullptr, "CAP"},
    {"-app", A_KIND, nullptr, "APP"},
    {"-kcap", A_KIND, nullptr, "KCAP"},
    {"-kapp", A_KIND, nullptr, "KAPP"},
    {"-mon", A_KIND, nullptr, "MON"},
    {"dmp", A_DUMP, nullptr, nullptr},
    {"-fn", A_FILE, nullptr, nullptr},
    {"-ofn", A_OUTFILE, nullptr, nullptr},
    {"-b", A_BUFSIZE, nullptr, nullptr},
    {"-fs", A_FILESIZE, nullptr, nullptr},
    {"-d", A_LOGLEVEL, nullptr, nullptr},
    {"-o", A_OUTLEVEL, nullptr, nullptr},
    {"-db", A_DB, nullptr, nullptr},
    {"-subsystem", A_DB, nullptr, nullptr},
    {"-schema", A_SCHEMA, nullptr, nullptr},
    {"-qualifier", A_SCHEMA, nullptr, nullptr},
    {"-df", A_FILTER, nullptr, nullptr},
};

const Keyword* findKeyword(const char* arg) {
  for (const Keyword& k : kKeywords)
    if (strcasecmp(arg, k.word) == 0) return &k;
  return nullptr;
}

// The complaint when a keyword's value is missing.
const char* missingValueText(Action a) {
  switch (a) {
    case A_OUTFILE: return "Error: No file name specified for \"-ofn\" option.\n";
    case A_DUMP: return "Error: Dump file name not specified.\n";
    case A_FILE: return "Error: No file name specified for \"-fn\" option.\n";
    case A_FILESIZE: return "Error: No size specified for \"-fs\" option.\n";
    case A_BUFSIZE: return "Error: No size specified for \"-b\" option.\n";
    case A_LOGLEVEL: return "Error: No log diagnostic level specified for \"-d\" option.\n";
    case A_OUTLEVEL: return "Error: No out diagnostic level specified for \"-o\" option.\n";
    case A_DB: return "Error: No name specified for \"%s\" option.\n";
    case A_SCHEMA: return "Error: No suffix specified for \"%s\" option.\n";
    case A_FILTER:
      return "Error: No function or component name specified for \"-df\" option.\n";
    default: return "";
  }
}

// Keeps a size within the block and file limits, saying so when it moved it.
uint32_t adjustSize(uint32_t size, const char* what) {
  uint32_t adjusted = size < TRC_MIN_SIZE ? TRC_MIN_SIZE : size > TRC_MAX_SIZE ? TRC_MAX_SIZE : size;
  if (adjusted != size) fprintf(trcOut(), "%s size adjusted to %d\n", what, (int)adjusted);
  return adjusted;
}

bool addFilter(trcOptions* o, const char* name, uint16_t mask) {
  if (o->filterCount == o->filterCapacity) {
    int capacity = o->filterCapacity == 0 ? 16 : o->filterCapacity * 2;
    void* grown = realloc(o->filters, sizeof(trcFilter) * static_cast<size_t>(capacity));
    if (grown == nullptr) return false;
    o->filters = static_cast<trcFilter*>(grown);
    o->filterCapacity = capacity;
  }
  o->filters[o->filterCount++] = trcFilter{name, mask};
  return true;
}

}  // namespace

uint16_t trcParseLevels(const char* text) {
  uint16_t mask = 0;
  for (const char* p = text; *p != '\0'; ++p) {
    if (*p == ',') continue;
    if (*p < '1' || *p > '6') break;
    mask |= static_cast<uint16_t>(1u << (*p - '1'));
  }
  return mask;
}

void trcLevelText(uint16_t mask, char* out) {
  char* p = out;
  for (int level = 1; level <= 6; ++level) {
    if (!(mask & (1u << (level - 1)))) continue;
    if (p != out) *p++ = ',';
    *p++ = static_cast<char>('0' + level);
  }
  if (p == out) *p++ = '0';
  *p = '\0';
}

uint32_t trcParseSize(const char* text) {
  uint32_t value = 0;
  const char* p = text;
  for (; *p >= '0' && *p <= '9'; ++p) value = value * 10u + static_cast<uint32_t>(*p - '0');
  switch (*p) {
    case 'k': case 'K': value *= 1024u; break;
    case 'm': case 'M': value *= 1048576u; break;
    case 'g': case 'G': value *= 1073741824u; break;
    default: break;
  }
  return value;
}

const char* trcKeyword(int i, int* values) {
  if (i < 0 || static_cast<size_t>(i) >= sizeof kKeywords / sizeof kKeywords[0]) return nullptr;
  const Keyword& k = kKeywords[i];
  *values = k.action == A_FLAG || k.action == A_KIND ? 0 : k.action == A_FILTER ? 2 : 1;
  return k.word;
}

void trcParseArgs(int argc, char** argv, trcOptions* o) {
  memset(o, 0, sizeof *o);
  o->logLevel = o->outLevel = 0x7FFF;
  o->schema = "KLP";
  o->bufferSize = TRC_DEFAULT_BUFFER_SIZE;
  o->maxFileSize = TRC_DEFAULT_FILE_SIZE;
  FILE* out = trcOut();
  for (int i = 1; i < argc; ++i) {
    const char* arg = argv[i] != nullptr ? argv[i] : "";
    const Keyword* k = findKeyword(arg);
    if (k == nullptr) {
      fprintf(out, "Unknown option \"%s\", ignored...\n", arg);
      o->error = true;
      continue;
    }
    if (k->action == A_FLAG) {
      o->*(k->flag) = true;
      continue;
    }
    if (k->action == A_KIND) {
      o->kind = k->kind;
      continue;
    }
    if (i + 1 >= argc || argv[i + 1] == nullptr) {
      fprintf(out, missingValueText(k->action), arg);
      o->error = true;
      return;
    }
    const char* value = argv[++i];
    switch (k->action) {
      case A_DUMP: o->dmp = true; o->fileName = value; break;
      case A_FILE: o->fileName = value; break;
      case A_OUTFILE: o->outFileName = value; break;
      case A_BUFSIZE: o->bufferSize = adjustSize(trcParseSize(value), "Buffer"); break;
      case A_FILESIZE: o->maxFileSize = adjustSize(trcParseSize(value), "File"); break;
      case A_LOGLEVEL:
        o->logLevel = o->outLevel = trcParseLevels(value);
        o->levelGiven = true;
        break;
      case A_OUTLEVEL: o->outLevel = trcParseLevels(value); break;
      case A_DB: o->dbName = value; break;
      case A_SCHEMA: o->schema = value; break;
      case A_FILTER:
        if (i + 1 >= argc || argv[i + 1] == nullptr) {
          fputs("Error: No diagnostic level mask specified for \"-df\" option.\n", out);
          o->error = true;
          return;
        }
        if (!addFilter(o, value, trcParseLevels(argv[++i]))) {
          fputs("Out of memory.\n", out);
          o->error = true;
          return;
        }
        break;
      default: break;
    }
  }
}

void trcFreeOptions(trcOptions* o) {
  free(o->filters);
  o->filters = nullptr;
  o->filterCount = o->filterCapacity = 0;
}

void trcApplyFilters(trcBlockHeader* h, const trcFilter* filters, int count) {
  for (int i = 0; i < count; ++i) {
    const trcFilter& f = filters[i];
    uint16_t word = static_cast<uint16_t>(f.mask | TRC_FILTER_OVERRIDE);
    for (int c = 0; c < TRC_COMPONENTS; ++c) {
      if (strcasecmp(trcComponentName(c), f.name) == 0) h->componentFilters[c] = word;
      for (int fn = 0; fn < trcFunctionRows(c); ++fn) {
        const char* row = trcFunctionRow(c, fn);
        if (row[0] != '\0' && strcasecmp(row, f.name) == 0) h->functionFilters[c][fn] = word;
      }
    }
  }
}
