/*
 * The control interface as a C program sees it: the public header compiles
 * as C, the records keep their layout, and the four functions are reached
 * through the shared library with their documented answers.
 */
#include <stddef.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include "klpapi.h"

_Static_assert(sizeof(klpResultBlock) == 1036, "result block is 1036 bytes");
_Static_assert(offsetof(klpResultBlock, text) == 8, "result text at 8");
_Static_assert(offsetof(klpStatusRequest, statusSize) == 260, "status size at 260");
_Static_assert(offsetof(klpStatusRequest, buffer) == 264, "buffer at 264");
_Static_assert(offsetof(klpStatusRequest, bufferSize) == 272, "buffer size at 272");
_Static_assert(offsetof(klpStatusRequest, requiredSize) == 276, "required size at 276");
_Static_assert(sizeof(klpStatusFmt3) == 2224, "format 3 is 2224 bytes");
_Static_assert(sizeof(klpStatusFmt2Record) == 12272, "format 2 record is 12272 bytes");

static int passed, failed;

static void check(int ok, const char* what) {
  if (ok) {
    ++passed;
  } else {
    ++failed;
    printf("FAILED: %s\n", what);
  }
}

int main(void) {
  /* A private IPC directory, so nothing here meets another run's queues. */
  char dir[] = "/tmp/klpcapiXXXXXX";
  if (!mkdtemp(dir)) {
    perror("mkdtemp");
    return 2;
  }
  setenv("TMPDIR", dir, 1);

  klpResultBlock res;
  klpReleaseInfo rel;
  klpStatusRequest req;
  memset(&res, 0, sizeof(res));
  memset(&rel, 0, sizeof(rel));
  memset(&req, 0, sizeof(req));

  check(klpStartProgram() == 0, "klpStartProgram answers 0");

  check(klpStopProgram(KLP_KIND_KCAP, "S", "K", 0, NULL) == KLP_API_MISSING_ARG,
        "stop without result block");
  check(klpStopProgram(9, "S", "K", 0, &res) == KLP_API_BAD_KIND && res.rc == KLP_API_BAD_KIND,
        "stop with a bad kind stores 2006");
  check(klpStopProgram(KLP_KIND_KCAP, "S", "K", -1, &res) == KLP_API_NEGATIVE_OPTION,
        "stop with a negative option");

  rel.kind = KLP_KIND_KCAP;
  rel.version = 9;
  rel.release = 1;
  rel.modification = 0;
  check(klpGetStatusSize(&rel, &req, &res) == 0 && req.statusSize == 2224 && res.rc == 0,
        "KCAP status size without a server");
  check(klpGetStatusSize(NULL, &req, &res) == KLP_API_MISSING_ARG &&
            strcmp(res.text, "klpReleaseInfo") == 0,
        "status size names the missing release information");

  check(klpGetStatus(&rel, &req, &res) == KLP_API_NO_BUFFER, "status without a buffer");
  {
    char buf[2224];
    req.buffer = buf;
    req.bufferSize = 0;
    check(klpGetStatus(&rel, &req, &res) == KLP_API_BUFFER_SIZE_ZERO, "status with size 0");
    req.bufferSize = sizeof(buf);
    rel.version = 8;
    check(klpGetStatus(&rel, &req, &res) == KLP_API_BAD_RELEASE, "status of another release");
    rel.version = 9;
    check(klpGetStatus(&rel, &req, &res) == KLP_API_NO_SERVER, "status without server name");
  }

  /* Nobody serves this name: the attach is tried five times, then 2013,
   * with the messages' texts although this program made no logger. */
  check(klpStopProgram(KLP_KIND_KCAP, "NOSERVER", "KLP", 0, &res) == KLP_API_NOT_ATTACHABLE &&
            res.rc == KLP_API_NOT_ATTACHABLE,
        "stop of a server that is not running");
  check(strstr(res.text, "KLP0506E") != NULL && strstr(res.text, "K Capture") != NULL &&
            strstr(res.text, "KLP0597E") != NULL,
        "the result text tells why");

  rmdir(dir);
  printf("%d passed, %d failed\n", passed, failed);
  return failed == 0 ? 0 : 1;
}
