/* Stand-in client library for the loader tests: the 39 OCI functions (less OCILobRead2 with
 * OCISTUB_WITHOUT_LOBREAD2); a few echo their arguments, the others answer a fixed number. */
#include <stdint.h>

#define STUB(name, value) int name() { return value; }

int OCIHandleFree(void* h, unsigned type) { return h ? (int)type : -1; }
int OCITerminate(unsigned mode) { return (int)mode * 2; }
int OCILobGetLength2(void* svc, void* err, void* loc, uint64_t* lenp) {
  (void)svc, (void)err, (void)loc;
  *lenp = 123456789012ull;
  return 0;
}

STUB(OCIHandleAlloc, 1) STUB(OCIEnvNlsCreate, 3) STUB(OCIServerAttach, 4) STUB(OCIAttrSet, 5)
STUB(OCISessionBegin, 6) STUB(OCISessionEnd, 7) STUB(OCIServerDetach, 8) STUB(OCIStmtPrepare2, 9)
STUB(OCIStmtExecute, 10) STUB(OCIBindByPos, 11) STUB(OCIDefineByPos, 12) STUB(OCIStmtFetch2, 13)
STUB(OCIDateTimeToText, 14) STUB(OCINumberToText, 15) STUB(OCIErrorGet, 16)
STUB(OCINumberToInt, 17) STUB(OCINumberToReal, 18) STUB(OCINumberIsInt, 19)
STUB(OCINumberFromInt, 20) STUB(OCINumberFromReal, 21) STUB(OCINumberFromText, 22)
STUB(OCITransRollback, 24) STUB(OCITransCommit, 25) STUB(OCIDescriptorAlloc, 26)
STUB(OCIDescriptorFree, 27) STUB(OCIDateTimeFromText, 28) STUB(OCIAttrGet, 29)
STUB(OCILobIsOpen, 30) STUB(OCILobOpen, 31) STUB(OCILobWrite2, 32)
#ifndef OCISTUB_WITHOUT_LOBREAD2
STUB(OCILobRead2, 33)
#endif
STUB(OCILobClose, 34) STUB(OCIStmtPrepare, 36) STUB(OCIDefineArrayOfStruct, 37)
STUB(OCIStmtRelease, 38) STUB(OCILobLocatorIsInit, 39)
