// docgen: writes the generated parts of the manual pages and of the shell
// completion from the programs' own tables (the two parameter tables, the
// command program's usage text, the trace command's keywords, the control
// interface's return codes), so that neither can drift from what the
// programs accept. Run by the build:
//
//   docgen TEMPLATE OUTPUT [KEY=value ...]
//
// copies TEMPLATE to OUTPUT, replacing every line that is a marker "@NAME@"
// by the part NAME, and "@KEY@" within a line by its value. An unknown
// marker, or a table entry the manual has no words for, fails the build.
#include <cstdio>
#include <cstring>
#include <fstream>
#include <map>
#include <sstream>
#include <string>
#include <vector>

#include "common/trace/trcblock.h"
#include "common/trace/trcopts.h"
#include "include/klpapi.h"
#include "xqpub/kcapcmdparms.h"
#include "xqpub/xqpubparms.h"

namespace {

std::string failure;  // the first reason the output cannot be made

void fail(const std::string& why) {
  if (failure.empty()) failure = why;
}

// Text for a roff text line: backslashes and minus signs escaped, and a
// leading dot or quote kept from being read as a request.
std::string roff(const std::string& text) {
  std::string out;
  for (char c : text) {
    if (c == '\\') out += "\\e";
    else if (c == '-') out += "\\-";
    else out += c;
  }
  if (!out.empty() && (out[0] == '.' || out[0] == '\'')) out.insert(0, "\\&");
  return out;
}

std::vector<ParmEntry> commandTable() {
  std::vector<ParmEntry> t(KCAPCMD_PARM_COUNT);
  buildKCapCmdParmTable(t.data());
  return t;
}

std::vector<ParmEntry> serverTable() {
  std::vector<ParmEntry> t(XQPUB_PARM_COUNT);
  buildXqpubParmTable(t.data());
  return t;
}

bool isPlaceholder(const ParmEntry& e) { return strncmp(e.name, "KLPPLACEHOLDER", 14) == 0; }

// The command program's usage text, line by line: "  NAME= : text" gives
// the word as the usage shows it ("NAME=" or "NAME=Y|N" or "NAME") and text.
struct UsageLine {
  std::string shown, text;
};

std::map<std::string, UsageLine> usageLines() {
  std::map<std::string, UsageLine> lines;
  std::istringstream in(kCapCmdUsageText);
  std::string line;
  while (std::getline(in, line)) {
    size_t colon = line.find(" : ");
    if (line.rfind("  ", 0) != 0 || colon == std::string::npos) continue;
    std::string shown = line.substr(2, line.find(' ', 2) - 2);
    lines[shown.substr(0, shown.find('='))] = UsageLine{shown, line.substr(colon + 3)};
  }
  return lines;
}

// Words of the command program's entries that its usage text leaves out.
const std::map<std::string, std::string> kUnlisted = {
    {"DEBUG", "Debug switch."},
    {"KLPTRC", "Trace switch of the command program itself."},
    {"RESUME", "Resume a suspended K Capture program."},
    {"SUSPEND", "Suspend the K Capture program until RESUME."},
};

std::string describeCommandEntry(const ParmEntry& e, const std::map<std::string, UsageLine>& usage) {
  auto u = usage.find(e.name);
  if (u != usage.end()) return u->second.text;
  auto k = kUnlisted.find(e.name);
  if (k != kUnlisted.end()) return k->second;
  fail(std::string("no description for ") + e.name);
  return "";
}

// "Integer from 100 to 600000; default 500." and the like.
std::string valueRule(const ParmEntry& e) {
  char buf[160];
  switch (e.type) {
    case PARM_INTEGER:
      snprintf(buf, sizeof buf, "Integer from %d to %d; default %d.", e.minimum, e.maximum,
               e.intValue);
      break;
    case PARM_BOOLEAN:
      snprintf(buf, sizeof buf, "Y or N; default %s.", e.boolValue ? "Y" : "N");
      break;
    case PARM_STRING:
      if (e.strValue != nullptr && e.strValue[0] != '\0')
        snprintf(buf, sizeof buf, "Text of at most %d characters; default %s.", e.maximum,
                 e.strValue);
      else
        snprintf(buf, sizeof buf, "Text of at most %d characters; empty by default.", e.maximum);
      break;
    default: return "";
  }
  return roff(buf);
}

// The tag line of a parameter: NAME=value for texts and numbers, and
// NAME[=Y|=N] for switches, which may be named alone.
std::string parmTag(const ParmEntry& e, bool bareSwitch) {
  if (e.type == PARM_BOOLEAN)
    return bareSwitch ? "\\fB" + roff(e.name) + "\\fR[\\fB=Y\\fR|\\fB=N\\fR]"
                      : "\\fB" + roff(e.name) + "=Y\\fR|\\fBN\\fR";
  return "\\fB" + roff(e.name) + "=\\fR\\fI" + (e.type == PARM_INTEGER ? "n" : "text") + "\\fR";
}

std::string shortForm(const ParmEntry& e) {
  size_t n = static_cast<size_t>(e.matchLength);
  if (n == 0 || n >= strlen(e.name)) return "";
  return "\nAny keyword of " + std::to_string(n) + " or more characters that begins with \\fB" +
         roff(std::string(e.name, n)) + "\\fR selects it.";
}

std::string commandParms() {
  auto usage = usageLines();
  std::string out;
  for (const ParmEntry& e : commandTable()) {
    if (isPlaceholder(e) || e.type == PARM_COMMAND) continue;
    out += ".TP\n" + parmTag(e, true) + "\n" + roff(describeCommandEntry(e, usage)) + "\n" +
           valueRule(e) + "\n";
  }
  return out;
}

std::string commandWords() {
  auto usage = usageLines();
  std::map<std::string, std::string> sorted;
  for (const ParmEntry& e : commandTable()) {
    if (isPlaceholder(e) || e.type != PARM_COMMAND) continue;
    auto u = usage.find(e.name);
    std::string tag = "\\fB" + roff(e.name) + "\\fR";
    if (u != usage.end() && u->second.shown.back() == '=')
      tag = "\\fB" + roff(e.name) + "\\fR[\\fB=\\fR\\fIqueue\\fR]";
    sorted[e.name] = ".TP\n" + tag + "\n" + roff(describeCommandEntry(e, usage)) +
                     "\nFunction code " + std::to_string(e.index) + ".\n";
  }
  std::string out;
  for (auto& [name, text] : sorted) out += text;
  return out;
}

std::string changeableParms() {
  std::string out;
  for (const ParmEntry& e : serverTable())
    if (e.changeable) out += ".TP\n" + parmTag(e, false) + "\n" + valueRule(e) + shortForm(e) + "\n";
  return out;
}

std::string serverParms() {
  std::string out;
  for (const ParmEntry& e : serverTable()) {
    out += ".TP\n" + parmTag(e, true) + "\n" + valueRule(e) + shortForm(e);
    if (e.changeable) out += "\nChangeable while the server runs (\\fBCHGPARMS\\fR).";
    if (e.display != 1) out += "\nNot shown by \\fBQRYPARMS\\fR.";
    out += "\n";
  }
  return out;
}

// ---- The trace command ---------------------------------------------------

struct TrcWords {
  const char* value;  // the value's name(s) after the keyword, roff
  const char* text;   // roff
};

std::string sizeRule(uint32_t def) {
  char buf[200];
  snprintf(buf, sizeof buf,
           "A decimal number of bytes, optionally followed by K, M or G; a size below %u is "
           "raised to it and one above %u lowered to it (with a note). Default %u.",
           TRC_MIN_SIZE, TRC_MAX_SIZE, def);
  return buf;
}

const std::map<std::string, TrcWords>& trcWords() {
  static const std::string bufferText =
      "Size of the shared trace buffer created by \\fBon\\fR. " + sizeRule(TRC_DEFAULT_BUFFER_SIZE);
  static const std::string fileText =
      "Largest size of the trace file written with \\fBon -fn\\fR; tracing to the file stops "
      "for good when the next lap does not fit. " + sizeRule(TRC_DEFAULT_FILE_SIZE);
  static const std::map<std::string, TrcWords> words = {
      {"on", {"", "Turn the trace on: create the server's shared trace buffer, start the buffer "
                  "keeper \\fBklptrcbp\\fR(1) and tell a running server to attach to it. "
                  "Refused when the trace is already on."}},
      {"off", {"", "Turn the trace off (normal end). The buffer is freed at once when no server "
                   "is attached to it, otherwise by the server."}},
      {"kill", {"", "Force the trace off (abnormal end) and free the buffer."}},
      {"clr", {"", "Empty the buffer."}},
      {"resetlock", {"", "Clear both locks of the buffer, when an abnormal end has left one "
                         "held."}},
      {"-holdlock", {"", "With \\fBdmp\\fR or a formatting style: when no private copy of the "
                         "buffer can be made, work on the live buffer under its lock (the "
                         "server's trace points wait meanwhile)."}},
      {"dmp", {"\\fIfile\\fR", "Write the buffer to \\fIfile\\fR, replacing it; refused when "
                               "it is the file the trace is written to directly."}},
      {"flw", {"", "Format as a flow: a summary indented by call depth, per process and "
                   "thread."}},
      {"fmt", {"", "Format every record in time order with its whole data structures."}},
      {"v7fmt", {"", "Format in the version-7 style of Apply traces."}},
      {"json", {"", "Write the records as trace-event JSON (one timeline per process and "
                    "thread) for trace viewers; not together with the other styles."}},
      {"stat", {"", "Show the status and version information of the buffer, or of the file "
                    "named with \\fB\\-fn\\fR (log level and status then show N/A)."}},
      {"statg", {"", "The same as \\fBstat\\fR."}},
      {"statlong", {"", "As \\fBstat\\fR, with module-level version information."}},
      {"diag", {"", "Show the filter settings of the buffer."}},
      {"-listsymbols", {"", "List the component and function names that \\fB\\-df\\fR "
                            "accepts."}},
      {"-hex", {"", "With \\fBfmt\\fR: show every object in hexadecimal."}},
      {"-help", {"", "Print the usage text."}},
      {"-cap", {"", "Server kind CAP (a key of the buffer)."}},
      {"-app", {"", "Server kind APP."}},
      {"-kcap", {"", "Server kind KCAP: a K Capture server such as \\fBklpkcap\\fR(1)."}},
      {"-kapp", {"", "Server kind KAPP."}},
      {"-mon", {"", "Server kind MON, the monitor."}},
      {"-db", {"\\fIname\\fR", "Database (server) name, a key of the buffer; upper-cased."}},
      {"-subsystem", {"\\fIname\\fR", "The same as \\fB\\-db\\fR."}},
      {"-schema", {"\\fIname\\fR", "Schema, a key of the buffer; upper-cased. Default KLP."}},
      {"-qualifier", {"\\fIname\\fR", "The same as \\fB\\-schema\\fR (an Apply qualifier)."}},
      {"-fn", {"\\fIfile\\fR", "With \\fBon\\fR: write the trace directly to \\fIfile\\fR as "
                               "well. With a formatting style or a status: read the trace "
                               "from \\fIfile\\fR instead of a buffer."}},
      {"-fs", {"\\fIsize\\fR", fileText.c_str()}},
      {"-b", {"\\fIsize\\fR", bufferText.c_str()}},
      {"-ofn", {"\\fIfile\\fR", "Append all output to \\fIfile\\fR (give an absolute path); "
                                "without it output goes to standard output."}},
      {"-d", {"\\fIlevels\\fR", "Global filter: the levels traced (with \\fBon\\fR or alone, "
                                "while the trace runs) and formatted. Default: all."}},
      {"-o", {"\\fIlevels\\fR", "Levels formatted only; the buffer's filter stays."}},
      {"-df", {"\\fIname levels\\fR", "Filter of one component or function (see "
                                      "\\fB\\-listsymbols\\fR), which may turn levels off "
                                      "globally back on; repeatable, the last for a name "
                                      "counts."}},
  };
  return words;
}

std::string trcKeywords() {
  const auto& words = trcWords();
  std::string out;
  int values = 0;
  for (int i = 0; const char* word = trcKeyword(i, &values); ++i) {
    auto w = words.find(word);
    if (w == words.end()) {
      fail(std::string("no description for the trace keyword ") + word);
      continue;
    }
    out += ".TP\n\\fB" + roff(word) + "\\fR" + (values ? std::string(" ") + w->second.value : "") +
           "\n" + w->second.text + "\n";
  }
  return out;
}

// ---- The control interface's return codes -----------------------------------

std::string apiCodes() {
  struct Code {
    int value;
    const char* name;
    const char* text;
  };
  static const Code codes[] = {
      {KLP_API_OK, "KLP_API_OK", "Success."},
      {KLP_API_NO_REPLY, "KLP_API_NO_REPLY", "The server did not answer in time (about 30 s)."},
      {KLP_API_BUFFER_TOO_SMALL, "KLP_API_BUFFER_TOO_SMALL",
       "The status buffer is too small; \\fIrequiredSize\\fR tells the size needed."},
      {KLP_API_NO_MEMORY, "KLP_API_NO_MEMORY", "Out of memory during the exchange."},
      {KLP_API_MISSING_ARG, "KLP_API_MISSING_ARG",
       "A required argument is missing; the result text names it."},
      {KLP_API_BAD_RELEASE, "KLP_API_BAD_RELEASE",
       "The release information is not version 9, release 1, modification 0."},
      {KLP_API_NO_BUFFER, "KLP_API_NO_BUFFER", "No status buffer."},
      {KLP_API_BUFFER_SIZE_ZERO, "KLP_API_BUFFER_SIZE_ZERO", "The status buffer size is 0."},
      {KLP_API_NEGATIVE_OPTION, "KLP_API_NEGATIVE_OPTION",
       "Negative option of \\fBklpStopProgram\\fR."},
      {KLP_API_BAD_KIND, "KLP_API_BAD_KIND", "Server kind outside 1 to 5."},
      {KLP_API_NO_SERVER, "KLP_API_NO_SERVER", "Empty server name."},
      {KLP_API_NO_SCHEMA, "KLP_API_NO_SCHEMA", "Empty schema."},
      {KLP_API_BAD_NAME, "KLP_API_BAD_NAME", "The server's name could not be built."},
      {KLP_API_ALLOC_FAILED, "KLP_API_ALLOC_FAILED", "The status buffer could not be allocated."},
      {KLP_API_NOT_ATTACHABLE, "KLP_API_NOT_ATTACHABLE",
       "The server's queue could not be reached: no such server runs."},
      {KLP_API_NO_REPLY_QUEUE, "KLP_API_NO_REPLY_QUEUE", "The reply queue could not be made."},
      {KLP_API_PUT_FAILED, "KLP_API_PUT_FAILED", "The command could not be sent."},
      {KLP_API_GET_FAILED, "KLP_API_GET_FAILED", "The reply could not be received."},
      {KLP_API_BAD_REPLY, "KLP_API_BAD_REPLY", "The reply has a wrong format version."},
  };
  std::string out;
  for (const Code& c : codes)
    out += ".TP\n\\fB" + std::to_string(c.value) + "\\fR \\fB" + c.name + "\\fR\n" + c.text + "\n";
  return out;
}

// ---- Shell completion word lists ---------------------------------------------

std::string join(const std::vector<std::string>& words) {
  std::string out;
  for (const std::string& w : words) out += (out.empty() ? "" : " ") + w;
  return out;
}

// The command program's words: its parameters (switches bare, the others
// with "="), its command words as the usage shows them, the switches among
// both sets, and the server parameters CHGPARMS may change.
std::string completionCommandWords() {
  auto usage = usageLines();
  std::vector<std::string> parms, commands, switches, changeable, changeableSwitches;
  for (const ParmEntry& e : commandTable()) {
    if (isPlaceholder(e) || e.index < 0) continue;
    auto u = usage.find(e.name);
    bool takesEq = e.type == PARM_COMMAND ? u != usage.end() && u->second.shown.back() == '='
                                          : e.type != PARM_BOOLEAN;
    (e.type == PARM_COMMAND ? commands : parms).push_back(std::string(e.name) + (takesEq ? "=" : ""));
    if (e.type == PARM_BOOLEAN) switches.push_back(e.name);
  }
  for (const ParmEntry& e : serverTable()) {
    if (!e.changeable) continue;
    changeable.push_back(std::string(e.name) + "=");
    if (e.type == PARM_BOOLEAN) changeableSwitches.push_back(e.name);
  }
  return "_klpkccmd_parms='" + join(parms) + "'\n_klpkccmd_commands='" + join(commands) +
         "'\n_klpkccmd_switches='" + join(switches) + "'\n_klpkccmd_changeable='" +
         join(changeable) + "'\n_klpkccmd_changeable_switches='" + join(changeableSwitches) + "'\n";
}

std::string completionTraceWords() {
  std::vector<std::string> all, files, values;
  int n = 0;
  for (int i = 0; const char* word = trcKeyword(i, &n); ++i) {
    all.push_back(word);
    bool file = strcmp(word, "-fn") == 0 || strcmp(word, "-ofn") == 0 || strcmp(word, "dmp") == 0;
    if (file) files.push_back(word);
    else if (n > 0) values.push_back(word);
  }
  return "_klptrc_words='" + join(all) + "'\n_klptrc_file_words='" + join(files) +
         "'\n_klptrc_value_words='" + join(values) + "'\n";
}

std::string part(const std::string& name) {
  if (name == "KCCMD_PARMS") return commandParms();
  if (name == "KCCMD_COMMANDS") return commandWords();
  if (name == "KCCMD_CHANGEABLE") return changeableParms();
  if (name == "KCAP_PARMS") return serverParms();
  if (name == "TRC_KEYWORDS") return trcKeywords();
  if (name == "API_CODES") return apiCodes();
  if (name == "COMPLETION_KCCMD") return completionCommandWords();
  if (name == "COMPLETION_TRC") return completionTraceWords();
  fail("unknown marker @" + name + "@");
  return "";
}

}  // namespace

int main(int argc, char** argv) {
  if (argc < 3) {
    fprintf(stderr, "usage: docgen TEMPLATE OUTPUT [KEY=value ...]\n");
    return 2;
  }
  std::ifstream in(argv[1]);
  if (!in) {
    fprintf(stderr, "docgen: cannot read %s\n", argv[1]);
    return 1;
  }
  std::string out, line;
  while (std::getline(in, line)) {
    if (line.size() > 2 && line.front() == '@' && line.back() == '@') {
      out += part(line.substr(1, line.size() - 2));
      continue;
    }
    for (int i = 3; i < argc; ++i) {
      const char* eq = strchr(argv[i], '=');
      if (eq == nullptr) continue;
      std::string token = "@" + std::string(argv[i], static_cast<size_t>(eq - argv[i])) + "@";
      for (size_t at = 0; (at = line.find(token, at)) != std::string::npos; at += strlen(eq + 1))
        line.replace(at, token.size(), eq + 1);
    }
    out += line + "\n";
  }
  if (!failure.empty()) {
    fprintf(stderr, "docgen: %s: %s\n", argv[1], failure.c_str());
    return 1;
  }
  std::ofstream o(argv[2]);
  o << out;
  return o.good() ? 0 : 1;
}
