// Fault injection for tests: any failable call of the platform layer can be
// made to fail on its Nth use, with the code the real call would give, so
// that the callers' own failure paths run. The checks are compiled in only
// when the build defines KLP_FAULTS (the `make test` build); in every other
// build they are absent and arming does nothing.
//
// A process is armed from outside by the environment variable
// KLP_TEST_FAULTS, a comma-separated list of items, each kept to the program
// of that name when it begins with "<program>/" (so that one text can be
// handed to every process of a test):
//
//   operation:use[-last|+][=code]
//       the use'th use of the operation fails (1-based), or every use from
//       use to last, or from use on; with the given code instead of the
//       operation's own
//   log=<file>
//       counts: appends one line per use, "<program> <pid> <operation>
//       <use>", ending in " fails" when the use is made to fail
//   sleep=<n>, wait=<n>
//       divides every platform sleep, or every wait on a queue (polls, gets,
//       puts waiting for room), by n, so that a walk over retry and
//       time-out paths does not wait the product's full times
//
// for example KLP_TEST_FAULTS="klpkccmd/queue.put:1,klpkccmd/sleep=20,log=/tmp/f".
// Operations, by the name used in the variable, and the code a failure gives:
//
//   alloc                 a platform object on the heap (null, or std::bad_alloc)
//   resid.queue           hsvIPCGetQueResID    ECF_INVALID_ARGUMENT
//   resid.memory          hsvIPCGetResID       ECF_INVALID_ARGUMENT
//   queue.create                               ECF_LIMIT_REACHED
//   queue.attach                               ECF_LIMIT_REACHED
//   queue.put                                  ECF_QUEUE_FULL
//   queue.get                                  ECF_TIMEOUT
//   queue.hasMessage                           answers false
//   queue.waitForMessage                       ECF_TIMEOUT, at once
//   memory.create                              ECF_LIMIT_REACHED
//   memory.attach                              ECF_LIMIT_REACHED
//   waitpost.create                            ECF_NO_MEMORY
//   waitpost.wait                              ECF_TIMEOUT, at once
//   waitpost.post                              ECF_WAITPOST_NOT_INITIALIZED
//   lib.load                                   ECF_NOT_FOUND (errno ENOENT)
//   lib.getFuncAddress                         ECF_NOT_FOUND
//   process.start                              ECF_NOT_FOUND
//   process.wait                               ECF_SYSTEM_ERROR
//   trapfile.open                              ECF_LIMIT_REACHED
//   trapfile.write                             ECF_LIMIT_REACHED
//
// Releasing calls (detach, destroy, unload, close) are not injectable: a
// failed release leaves its object behind whatever the caller does.
#pragma once

#include <cstdint>

#include "common/platform/hsv.h"

enum hsvFaultOp : int {
  HSV_FAULT_ALLOC,
  HSV_FAULT_RESID_QUEUE,
  HSV_FAULT_RESID_MEMORY,
  HSV_FAULT_QUEUE_CREATE,
  HSV_FAULT_QUEUE_ATTACH,
  HSV_FAULT_QUEUE_PUT,
  HSV_FAULT_QUEUE_GET,
  HSV_FAULT_QUEUE_HAS_MESSAGE,
  HSV_FAULT_QUEUE_WAIT,
  HSV_FAULT_MEMORY_CREATE,
  HSV_FAULT_MEMORY_ATTACH,
  HSV_FAULT_WAITPOST_CREATE,
  HSV_FAULT_WAITPOST_WAIT,
  HSV_FAULT_WAITPOST_POST,
  HSV_FAULT_LIB_LOAD,
  HSV_FAULT_LIB_SYMBOL,
  HSV_FAULT_PROCESS_START,
  HSV_FAULT_PROCESS_WAIT,
  HSV_FAULT_TRAPFILE_OPEN,
  HSV_FAULT_TRAPFILE_WRITE,
  HSV_FAULT_OPS
};

// True when this build carries the checks.
bool hsvFaultCompiledIn();
// Arms this process from a text of the variable's form, replacing what the
// variable set, and sets every use count to 0; null disarms. False (and
// nothing armed) when an item cannot be used or the checks are not
// compiled in. Only while no other thread calls the platform layer.
bool hsvFaultArm(const char* spec);
// Uses of the operation in this process since it was armed.
uint32_t hsvFaultUses(hsvFaultOp op);
