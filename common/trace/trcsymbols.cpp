#include "common/trace/trcsymbols.h"

#include "common/trace/trcblock.h"

namespace {

struct Component {
  const char* name;
  int rows;
};

constexpr Component kComponents[TRC_COMPONENTS] = {
    {"Sample Trace", 11},
    {"test", 32},
    {"Init/Termination", 24},
    {"Capture Queues", 1},
    {"Capture Worker", 40},
    {"Capture Log Read", 48},
    {"Capture Transactions", 54},
    {"Capture Prune", 23},
    {"Capture Admin", 2},
    {"Capture Monitor", 7},
    {"common sql routines", 25},
    {"Capture/Apply Common Function", 207},
    {"msgToLog Function", 19},
    {"Error Recovery Function", 18},
    {"Apply Init/Term", 7},
    {"Apply Worker", 2},
    {"Apply Admin", 2},
    {"Apply Commands", 3},
    {"TRC_APPLY", 224},
    {"Capture Commands Engine", 2},
    {"Capture Commands Program", 2},
    {"registration", 10},
    {"XKAPP HouseKeeping", 8},
    {"XKAPP Browser", 62},
    {"XKAPP Subscription", 110},
    {"XKAPP Apply Agent", 41},
    {"XKAPP Trans", 73},
    {"Monitor Program", 2},
    {"Monitor Worker", 2},
    {"Monitor Admin", 2},
    {"Monitor Data Definitions", 12},
    {"Monitor Update Cntl Server", 21},
    {"Monitor Monitor Server", 30},
    {"Monitor Command", 2},
    {"XKCAP Program", 12},
    {"XKCAP Admin Thread", 4},
    {"XKCAP Worker Thread", 6},
    {"XKCAP Prune Thread", 2},
    {"XKCAP Subscription", 241},
    {"XKCAP SQL Processing", 43},
    {"XKCAP XQ Interface", 58},
    {"XKCAP Commands", 3},
    {"XQ Converter Manager", 24},
    {"XQ XML Generation", 21},
    {"XQ Util", 2},
    {"XKCAP Admin Queue Handler", 22},
    {"XKCAP XML message parser", 7},
    {"TDIFF Symmetric Difference", 7},
    {"XKCAP Message Processer", 32},
    {"XKAPP Monitoring", 8},
    {"XKCAP EOL Flush Thread", 11},
    {"XKCAP Publish Separate LOB XQ messages", 15},
    {"XKAPP Pruning", 7},
    {"Apply Monitor", 3},
};

constexpr int totalRows() {
  int n = 0;
  for (const Component& c : kComponents) n += c.rows;
  return n;
}
static_assert(totalRows() == 1656, "the symbol table has 1656 function rows");

// Named rows. Every other row of a component is unused ("") except row 0,
// "ZERO_PLACE_HOLDER" in all components but 0 and 2, so that ids start at 1.
struct NamedRow {
  int component, function;
  const char* name;
};

constexpr NamedRow kNamedRows[] = {
    {0, 0, "main"}, {0, 1, "printcb"}, {0, 2, "smallsample"}, {0, 3, "alldcs"},
    {0, 4, "mediumsample"}, {0, 5, "longsample"}, {0, 6, "thesepoints"}, {0, 7, "functionA"},
    {0, 8, "functionB"}, {0, 9, "noflow"}, {0, 10, "exits"},
    {6, 53, "compareIgnTransCriteria"},
    // The recovery manager.
    {7, 1, "recoveryMgr::erSetRecovery"}, {7, 2, "recoveryMgr::erUndoRecovery"},
    {11, 1, "OrdList::delList"}, {11, 2, "OrdList::putHead"}, {11, 3, "OrdList::putTail"},
    {11, 4, "OrdList::getHead"}, {11, 5, "OrdList::getTail"}, {11, 6, "ordListDeChain"},
    {11, 7, "KlpThread::init"}, {11, 8, "KlpThread::start"}, {11, 9, "KlpThread::stop"},
    {11, 10, "HoldLockMain"},
    // The command engine.
    {11, 41, "cmdsEngine"}, {11, 42, "cmdsHandleMessage"}, {11, 43, "cmdsSendReply"},
    {11, 44, "cmdsStartStop"}, {11, 45, "cmdsCheckDbStatus"},
    {11, 93, "klpdll::loadLib"}, {11, 94, "getFileHandle"},
    // The OCI call wrappers, one row each in the order of their table.
    {11, 168, "ORADL::OCIInit"},
    {11, 169, "OCIHandleAlloc"}, {11, 170, "OCIHandleFree"}, {11, 171, "OCIEnvNlsCreate"},
    {11, 172, "OCIServerAttach"}, {11, 173, "OCIAttrSet"}, {11, 174, "OCISessionBegin"},
    {11, 175, "OCISessionEnd"}, {11, 176, "OCIServerDetach"}, {11, 177, "OCIStmtPrepare2"},
    {11, 178, "OCIStmtExecute"}, {11, 179, "OCIBindByPos"}, {11, 180, "OCIDefineByPos"},
    {11, 181, "OCIStmtFetch2"}, {11, 182, "OCIDateTimeToText"}, {11, 183, "OCINumberToText"},
    {11, 184, "OCIErrorGet"}, {11, 185, "OCINumberToInt"}, {11, 186, "OCINumberToReal"},
    {11, 187, "OCINumberIsInt"}, {11, 188, "OCINumberFromInt"}, {11, 189, "OCINumberFromReal"},
    {11, 190, "OCINumberFromText"}, {11, 191, "OCITerminate"}, {11, 192, "OCITransRollback"},
    {11, 193, "OCITransCommit"}, {11, 194, "OCIDescriptorAlloc"}, {11, 195, "OCIDescriptorFree"},
    {11, 196, "OCIDateTimeFromText"}, {11, 197, "OCIAttrGet"}, {11, 198, "OCILobIsOpen"},
    {11, 199, "OCILobOpen"}, {11, 200, "OCILobWrite2"}, {11, 201, "OCILobRead2"},
    {11, 202, "OCILobClose"}, {11, 203, "OCILobGetLength2"}, {11, 204, "OCIStmtPrepare"},
    {11, 205, "OCIDefineArrayOfStruct"}, {11, 206, "OCIStmtRelease"},
    // Code-page conversion.
    {42, 1, "ConvMgr::ConvMgr"}, {42, 11, "ConvMgr::openConverter"}, {42, 13, "ConvMgr::convert"},
};

struct Table {
  const char* rows[TRC_COMPONENTS][TRC_FUNCTIONS];
  Table() {
    for (int c = 0; c < TRC_COMPONENTS; ++c)
      for (int f = 0; f < TRC_FUNCTIONS; ++f)
        rows[c][f] = f < kComponents[c].rows ? "" : nullptr;
    for (int c = 0; c < TRC_COMPONENTS; ++c)
      if (c != 0 && c != 2) rows[c][0] = "ZERO_PLACE_HOLDER";
    for (const NamedRow& r : kNamedRows) rows[r.component][r.function] = r.name;
  }
};

const Table& table() {
  static const Table t;
  return t;
}

}  // namespace

int trcFunctionRows(int component) {
  return component >= 0 && component < TRC_COMPONENTS ? kComponents[component].rows : 0;
}

const char* trcComponentName(int component) {
  return component >= 0 && component < TRC_COMPONENTS ? kComponents[component].name : nullptr;
}

const char* trcFunctionRow(int component, int function) {
  if (component < 0 || component >= TRC_COMPONENTS || function < 0 || function >= TRC_FUNCTIONS)
    return nullptr;
  return table().rows[component][function];
}

const char* trcFunctionName(int component, int function) {
  const char* row = trcFunctionRow(component, function);
  return row != nullptr && row[0] != '\0' ? row : "UNKNOWN FUNCTION";
}
