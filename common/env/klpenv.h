// The process environment: the one record per process of who this process is
// (program name and level, start time), where its inter-process resources live
// (IPC directory, name prefix) and, in a server, its receiving queue. The
// application version block and the module list travel into the trace
// control block, so their byte layouts are fixed.
#pragma once

#include <cstddef>
#include <cstdint>

#include "common/platform/hsv.h"

struct recoveryRes;

constexpr size_t KLP_ENV_PATH_MAX = 1040;     // instance path, IPC directory
constexpr size_t KLP_UNIQUE_NAME_SIZE = 161;  // name prefix: 160 characters and NUL
constexpr size_t KLP_PROGRAM_NAME_SIZE = 10;
constexpr size_t KLP_JOB_NAME_SIZE = 9;
constexpr size_t KLP_APPVER_SIZE = 384;
constexpr int KLP_MODULE_TABLE_COUNT = 21;    // records of the library's own table
constexpr size_t KLP_MODULE_RECORD_SIZE = 44;
constexpr size_t KLP_MODULE_LIST_HEADER = 12;
constexpr size_t KLP_MODULE_LIST_BASE =
    KLP_MODULE_LIST_HEADER + KLP_MODULE_TABLE_COUNT * KLP_MODULE_RECORD_SIZE;  // 936

#pragma pack(push, 1)
// Release information (232 bytes).
struct klpReleaseBlock {
  char programName[KLP_PROGRAM_NAME_SIZE];  // NUL-terminated
  int16_t version;
  int16_t release;
  int16_t modification;
  char reserved;
  char uniqueName[KLP_UNIQUE_NAME_SIZE];    // the name prefix; blank first byte: not set
  char archLevel[4];                        // not terminated
  char jobName[KLP_JOB_NAME_SIZE];          // program name cut to 9 characters; unterminated when 9
  char programFixLevel[8];
  char baseFixLevel[33];
};

// Application version block (384 bytes): release information followed by the
// database version information.
struct klpAppVersion {
  klpReleaseBlock rel;        // 0
  int16_t dbVersion;          // 232
  int16_t dbRelease;          // 234
  int16_t dbModification;     // 236
  char dbMode;                // 238
  char dbInstance[9];         // 239
  char dbGroupAttach[5];      // 248
  char dbName[17];            // 253
  char dbType;                // 270
  char dbNodeName[9];         // 271
  char dbAuthId[9];           // 280
  char dbServerType[17];      // 289
  char dbPlatform;            // 306
  char pad1;                  // 307
  int16_t dbAppCodePage;      // 308
  int16_t dbPartition;        // 310
  int16_t dbCatalogPartition; // 312
  int16_t dbNumPartitions;    // 314
  char reserved2[12];         // 316
  int32_t dbServerCodePage;   // 328
  char reserved3[52];         // 332
};

// One module record of the module list (44 bytes), each text zero-padded.
struct klpModuleRecord {
  char name[14];
  char fixLevel[9];
  char compileStamp[21];      // "Mon dd yyyy hh:mm:ss" and NUL
};

// Module list header (12 bytes); the records follow it.
struct klpModuleList {
  char eyeCatcher[9];         // "KLPSMODL" and NUL
  char notSet;
  uint16_t count;             // 21 + records the caller added
};
#pragma pack(pop)

static_assert(sizeof(klpReleaseBlock) == 232, "release block layout");
static_assert(sizeof(klpAppVersion) == KLP_APPVER_SIZE, "application version layout");
static_assert(sizeof(klpModuleRecord) == KLP_MODULE_RECORD_SIZE, "module record layout");
static_assert(sizeof(klpModuleList) == KLP_MODULE_LIST_HEADER, "module list header layout");

// The module records of a list (they start right after the header).
inline klpModuleRecord* klpModuleRecords(klpModuleList* list) {
  return reinterpret_cast<klpModuleRecord*>(reinterpret_cast<char*>(list) +
                                            KLP_MODULE_LIST_HEADER);
}

// The process environment record.
struct klpEnv {
  HSVHIPCQueue* rcvQueue;          // the server's receiving queue; null when none
  char* rcvQueueName;              // "(%s, %s, %s)" of its resource id; null when none
  recoveryRes* rcvQueueRecovery;   // destroys the receiving queue if the process traps
  char instancePath[KLP_ENV_PATH_MAX];
  char ipcDir[KLP_ENV_PATH_MAX];   // empty until first use; always ends in "/"
  klpAppVersion appVersion;
  klpModuleList* moduleList;       // built by setEnvModServ, or null
  int64_t startTime;               // UTC seconds
  char programName[64];            // the whole program name (the block keeps 9 characters)
  char jobName[KLP_JOB_NAME_SIZE + 1];  // the block's job name, terminated
  char programLevel[96];           // "%s %d.%d.%d" of name, version, release, modification
  int32_t dbUnavailable;           // set by the database layer; read by the command engine
};

// The process's environment (cleared at first use).
klpEnv* klpGetEnv();

// Clears the record as at process start: releases the module list and the
// queue name, blanks the version block (architecture level "0801"). Refused
// (2002) while a receiving queue exists.
int klpEnvClear(klpEnv* env);

// Records program name, level and start time and issues the program-level
// message (600). The schema parameter is blank while the message is issued.
void setEnvTovRIB(klpEnv* env, const char* programName, int version, int release,
                  int modification);

// Forms the name prefix "server.schema.word" from parameters 0 and 2 of the
// current parameter object (a trailing "." of the schema is dropped).
// Answers 0; 2003 when there is no parameter object or no server name; 6005
// when the prefix would not fit its 160 characters (the prefix is then left
// unchanged).
int setEnvNamePrefix(klpEnv* env, const char* componentWord);

// The builder behind setEnvNamePrefix, shared with the control interface:
// "server.schema.word" into out. Answers 0, 2003 (no server) or 6005 (does
// not fit; out is then empty).
int klpBuildNamePrefix(char* out, size_t outLen, const char* server, const char* schema,
                       const char* word);

// The IPC directory: TMPDIR (or "/tmp/" when unset or empty) with "/"
// appended when missing; filled on first use and kept.
const char* getEnvIPCDir(klpEnv* env);

// The name prefix, or null while it is not set.
const char* getEnvNamePrefix(klpEnv* env);

// The program name ("" until setEnvTovRIB) and the job name (the program
// name cut to 9 characters).
const char* getEnvProgramName(klpEnv* env);
const char* getEnvJobName(klpEnv* env);

// Builds the module list: the library's 21 table records followed by the
// `count` added records. A failed allocation issues message 543 and keeps no
// list. A list built earlier is replaced.
void setEnvModServ(klpEnv* env, const klpModuleRecord* added, int count);

// Server side: creates the receiving queue "<IPC directory><prefix>.IPC",
// destroying a queue a previous run left behind. Answers 0, 1003 (no queue
// object), 2003 (no name prefix) or 804 (the queue could not be created).
int setEnvIpcQRcvHdl(klpEnv* env);

// Destroys the receiving queue, when there is one.
void delEnvIpcQRcvHdl(klpEnv* env);

// The receiving queue (null when none).
HSVHIPCQueue* getEnvIpcQRcvHdl(klpEnv* env);
// Its printable resource id ("[NOT SET]" when none).
const char* getEnvIpcQRcvName(klpEnv* env);
