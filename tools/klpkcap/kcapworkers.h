// The sample K Capture server's worker threads and what they answer.
#pragma once

#include <cstddef>
#include <cstdint>

class OrdList;
struct IpcMsg;

// Starts the worker threads on `threads`. Answers 0, or the code of the
// first thread that could not be created (801, 802).
int kcapStartWorkers(OrdList* threads);

// Payload of the detailed status (function code 60), in the placement the
// status collector's format 3 reads: up time at 12, the offset of the
// length-prefixed log file name at 16, active subscriptions at 20, the
// current time (26 characters) at 24, the log sequence number at 51, the
// resident memory at 64, no optional section (offset 0 at 68).
// Answers the reply (freeIpcMsg) or null when memory ran out.
IpcMsg* kcapDetailsReply(int64_t upTime, const char* logFile, int32_t memoryBytes);

// Resident memory of this process in bytes (from /proc/self/statm); 0 when
// unknown, INT32_MAX when larger.
int32_t kcapResidentBytes();

// The database status check of a server without a database.
int kcapDbStatus(char* statusText, size_t len);
