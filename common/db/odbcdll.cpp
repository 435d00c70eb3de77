// The program's two ODBC driver descriptors. The first needs every function;
// the second works without the ones marked optional.
#include "common/db/klpdll.h"

namespace {

#define KLP_ODBC_FUNCTIONS(X)                                                                  \
  X(SQLAllocHandle, 0) X(SQLBindCol, 0) X(SQLBindParameter, 1) X(SQLCancel, 1)                 \
  X(SQLCloseCursor, 0) X(SQLColAttribute, 0) X(SQLColumns, 0) X(SQLConnect, 0)                 \
  X(SQLDataSources, 0) X(SQLDescribeCol, 0) X(SQLDescribeParam, 0) X(SQLDisconnect, 0)         \
  X(SQLEndTran, 0) X(SQLExecDirect, 0) X(SQLExecute, 0) X(SQLExtendedFetch, 1) X(SQLFetch, 0)  \
  X(SQLForeignKeys, 1) X(SQLFreeHandle, 0) X(SQLFreeStmt, 0) X(SQLGetDiagRec, 0)               \
  X(SQLGetInfo, 0) X(SQLGetLength, 1) X(SQLGetPosition, 1) X(SQLGetSubString, 1)               \
  X(SQLNumResultCols, 0) X(SQLPrepare, 0) X(SQLRowCount, 0) X(SQLSetConnectAttr, 0)            \
  X(SQLSetCursorName, 0) X(SQLSetEnvAttr, 0) X(SQLSetStmtAttr, 0) X(SQLSpecialColumns, 0)      \
  X(SQLStatistics, 0)

#define KLP_ODBC_REQUIRED(fn, opt) {#fn, nullptr},
#define KLP_ODBC_MAYBE(fn, opt) {#fn, (opt) ? KLPDLL_OPTIONAL : nullptr},

klpDLLFunc gOdbcFunctions[] = {KLP_ODBC_FUNCTIONS(KLP_ODBC_REQUIRED)};
klpDLLFunc gOdbcAltFunctions[] = {KLP_ODBC_FUNCTIONS(KLP_ODBC_MAYBE)};

const klpDLLCandidate kOdbcCandidates[] = {{"libodbc.so.2", ""}};
const klpDLLCandidate kOdbcAltCandidates[] = {{"libiodbc.so.2", ""}};

}  // namespace

klpDLL& klpOdbcDLL() {
  static klpDLL dll("ODB_DLL", kOdbcCandidates, 1, gOdbcFunctions, 34);
  return dll;
}

klpDLL& klpOdbcAltDLL() {
  static klpDLL dll("ODB_DLL", kOdbcAltCandidates, 1, gOdbcAltFunctions, 34);
  return dll;
}

static_assert(sizeof gOdbcFunctions / sizeof gOdbcFunctions[0] == 34, "ODBC function table");
