/* The control interface from C: the header compiles as C, the records keep
 * their layout, the four functions check their arguments in order, and a
 * failure brings its messages' texts although this program made no logger. */
#include <stddef.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include "klpapi.h"

_Static_assert(sizeof(klpReleaseInfo) == 12 && offsetof(klpReleaseInfo, modification) == 8, "release");
_Static_assert(offsetof(klpStatusRequest, schema) == 129 && offsetof(klpStatusRequest, statusSize) == 260 &&
                   offsetof(klpStatusRequest, buffer) == 264 && offsetof(klpStatusRequest, bufferSize) == 272 &&
                   offsetof(klpStatusRequest, requiredSize) == 276, "request");
_Static_assert(sizeof(klpResultBlock) == 1036 && offsetof(klpResultBlock, text) == 8, "result block");
_Static_assert(sizeof(klpStatusFmt1) == 8 && sizeof(klpStatusThread) == 24 &&
                   offsetof(klpStatusThread, kind) == 16 && offsetof(klpStatusThread, state) == 20, "format 1");
_Static_assert(sizeof(klpStatusFmt3) == 2224 && offsetof(klpStatusFmt3, logFile) == 8 &&
                   offsetof(klpStatusFmt3, activeSubs) == 1036 && offsetof(klpStatusFmt3, currentLogTime) == 1040 &&
                   offsetof(klpStatusFmt3, allPublishedLsn) == 1067 && offsetof(klpStatusFmt3, currentMemory) == 1132 &&
                   offsetof(klpStatusFmt3, sectionText) == 1136 && offsetof(klpStatusFmt3, sectionA) == 2161 &&
                   offsetof(klpStatusFmt3, sectionB) == 2191, "format 3");
_Static_assert(sizeof(klpStatusFmt2) == 1048 && offsetof(klpStatusFmt2, value8) == 8 &&
                   offsetof(klpStatusFmt2, text) == 12 && offsetof(klpStatusFmt2, value1044) == 1044, "format 2");
_Static_assert(sizeof(klpStatusFmt2Record) == 12272 && offsetof(klpStatusFmt2Record, value52) == 52 &&
                   offsetof(klpStatusFmt2Record, block83) == 83 && offsetof(klpStatusFmt2Record, block148) == 148 &&
                   offsetof(klpStatusFmt2Record, time213) == 213 && offsetof(klpStatusFmt2Record, value240) == 240 &&
                   offsetof(klpStatusFmt2Record, value248) == 248 && offsetof(klpStatusFmt2Record, value264) == 264 &&
                   offsetof(klpStatusFmt2Record, text268) == 268 && offsetof(klpStatusFmt2Record, text3269) == 3269 &&
                   offsetof(klpStatusFmt2Record, text9271) == 9271, "format 2 record");

static int passed, failed;

static void check(int ok, const char* what) {
  ok ? ++passed : ++failed;
  if (!ok) printf("FAILED: %s\n", what);
}

int main(void) {
  /* A private IPC directory, so nothing here meets another run's queues. */
  char dir[] = "/tmp/klpcapiXXXXXX";
  if (!mkdtemp(dir)) return 2;
  setenv("TMPDIR", dir, 1);
  klpResultBlock res = {0};
  klpReleaseInfo rel = {KLP_KIND_CAP, 9, 1, 0}, kcap = {KLP_KIND_KCAP, 9, 1, 0}, bad = {6, 9, 1, 0};
  klpReleaseInfo old[] = {{3, 8, 1, 0}, {3, 9, 0, 0}, {3, 9, 1, 1}};
  static klpStatusRequest req, none;
  char buf[64];
  strcpy(req.serverName, "S1");
  strcpy(req.schema, "KLP");
  check(klpStartProgram() == 0, "klpStartProgram answers 0");
  check(klpStopProgram(1, "S", "K", 0, NULL) == 2001, "stop without result block");
  check(klpStopProgram(0, "S", "K", 0, &res) == 2006 && res.rc == 2006, "stop with kind 0 stores 2006");
  check(klpStopProgram(6, "S", "K", 0, &res) == 2006, "stop with kind 6");
  check(klpStopProgram(1, "", "K", -1, &res) == 2007, "stop without server");
  check(klpStopProgram(5, "S", " ", -1, &res) == 2008, "stop without schema");
  check(klpStopProgram(1, "S", "K", -1, &res) == 2005, "stop with a negative option");
  check(klpGetStatusSize(&rel, &req, NULL) == 2001, "size without result block");
  memset(&res, 0x7f, sizeof(res));
  check(klpGetStatusSize(NULL, &req, &res) == 2001 && !strcmp(res.text, "klpReleaseInfo"), "size names the release");
  check(klpGetStatusSize(&rel, NULL, &res) == 2001 && !strcmp(res.text, "klpGetStatusDataSize"), "size names the request");
  for (int i = 0; i < 3; ++i) check(klpGetStatusSize(&old[i], &req, &res) == 2002, "size of another release");
  check(klpGetStatusSize(&bad, &req, &res) == 2006, "size of kind 6");
  check(klpGetStatusSize(&kcap, &none, &res) == 0 && none.statusSize == 2224 && res.rc == 0, "KCAP size, no server");
  strcpy(none.serverName, "S1");
  check(klpGetStatusSize(&rel, &none, &res) == 2008, "size without schema");
  check(klpGetStatus(&rel, &req, NULL) == 2001, "status without result block");
  check(klpGetStatus(NULL, &req, &res) == 2001 && !strcmp(res.text, "klpReleaseInfo"), "status names the release");
  check(klpGetStatus(&rel, NULL, &res) == 2001 && !strcmp(res.text, "klpGetStatusData"), "status names the request");
  check(klpGetStatus(&rel, &req, &res) == 2003, "status without a buffer");
  req.buffer = buf;
  for (int size = 0; size >= -1; --size) {
    req.bufferSize = size;
    check(klpGetStatus(&rel, &req, &res) == 2004, "status with buffer size 0 or below");
  }
  req.bufferSize = sizeof(buf);
  for (int i = 0; i < 3; ++i) check(klpGetStatus(&old[i], &req, &res) == 2002, "status of another release");
  check(klpGetStatus(&bad, &req, &res) == 2006, "status of kind 6");
  strcpy(req.serverName, " ");
  check(klpGetStatus(&rel, &req, &res) == 2007 && res.rc == 2007, "status without server name");
  /* No server runs: refused, with the texts that say why. */
  char path[64];
  snprintf(path, sizeof(path), "%s/NONE.KLP.KCAP.IPC", dir);
  check(klpStopProgram(KLP_KIND_KCAP, "none", "KLP", 0, &res) == 2013 && res.rc == 2013, "stop of no server");
  check(strstr(res.text, "KLP0506E") && strstr(res.text, "\"K Capture\"") && strstr(res.text, "KLP0597E") &&
            strstr(res.text, path) && strstr(res.text, "object not found"),
        "the result text tells why");
  rmdir(dir);
  printf("%d passed, %d failed\n", passed, failed);
  return failed == 0 ? 0 : 1;
}
