/*
 * Control interface of the K Capture command program, exported with C
 * linkage by the shared library libklp. Another program uses it to stop a
 * server or to fetch its status data without going through the console.
 *
 * Pure C header: usable from C and C++. All integers of the records below are
 * little-endian; the byte offsets are part of the interface and must not
 * change.
 */
#ifndef KLPAPI_H
#define KLPAPI_H

#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

#if defined(__GNUC__)
#define KLP_API __attribute__((visibility("default")))
#else
#define KLP_API
#endif

/* Server kinds (klpReleaseInfo.kind, klpStopProgram's kind). */
enum {
  KLP_KIND_APP = 1,
  KLP_KIND_KAPP = 2,
  KLP_KIND_CAP = 3,
  KLP_KIND_KCAP = 4,
  KLP_KIND_MON = 5
};

/* The only interface level accepted: version 9, release 1, modification 0. */
enum { KLP_API_VERSION = 9, KLP_API_RELEASE = 1, KLP_API_MODIFICATION = 0 };

/* Return codes of the exported functions (also stored in the result block). */
enum {
  KLP_API_OK = 0,
  KLP_API_NO_REPLY = 1000,          /* the server did not answer in time */
  KLP_API_BUFFER_TOO_SMALL = 1001,  /* caller's status buffer too small */
  KLP_API_NO_MEMORY = 1003,         /* out of memory during the exchange */
  KLP_API_MISSING_ARG = 2001,       /* a required argument is missing */
  KLP_API_BAD_RELEASE = 2002,       /* release information is not 9.1.0 */
  KLP_API_NO_BUFFER = 2003,         /* no status buffer */
  KLP_API_BUFFER_SIZE_ZERO = 2004,  /* status buffer size is 0 */
  KLP_API_NEGATIVE_OPTION = 2005,   /* negative option of klpStopProgram */
  KLP_API_BAD_KIND = 2006,          /* server kind outside 1..5 */
  KLP_API_NO_SERVER = 2007,         /* empty server name */
  KLP_API_NO_SCHEMA = 2008,         /* empty schema */
  KLP_API_BAD_NAME = 2009,          /* the server name could not be built */
  KLP_API_ALLOC_FAILED = 2012,      /* the status buffer could not be allocated */
  KLP_API_NOT_ATTACHABLE = 2013,    /* server queue not attachable */
  KLP_API_NO_REPLY_QUEUE = 2014,    /* reply queue not creatable */
  KLP_API_PUT_FAILED = 2015,        /* command could not be put */
  KLP_API_GET_FAILED = 2016,        /* reply could not be got */
  KLP_API_BAD_REPLY = 2017          /* reply has a wrong format */
};

/* Release information: the first argument of the status functions. */
typedef struct klpReleaseInfo {
  int32_t kind;         /* KLP_KIND_* */
  int16_t version;      /* must be 9 */
  int16_t release;      /* must be 1 */
  int16_t modification; /* must be 0 */
} klpReleaseInfo;

/* Status request: the second argument of klpGetStatusSize/klpGetStatus. */
typedef struct klpStatusRequest {
  char serverName[129]; /* 0: up to 128 characters, ended by a blank or NUL */
  char schema[129];     /* 129: up to 128 characters, ended by a blank or NUL */
  char reserved[2];     /* 258: alignment */
  int32_t statusSize;   /* 260: out: size klpGetStatus will need */
  void* buffer;         /* 264: in: the caller's status buffer */
  int32_t bufferSize;   /* 272: in: capacity of buffer in bytes */
  int32_t requiredSize; /* 276: out: bytes the status data needs */
} klpStatusRequest;

/* Result block: last argument of the exported functions, 1036 bytes. */
typedef struct klpResultBlock {
  int16_t rc;          /* 0: the return code */
  char reserved[6];    /* 2 */
  char text[1028];     /* 8: missing argument's name, or the messages issued */
} klpResultBlock;

/* ---- Status data ------------------------------------------------------ */

/* Format 1 (APP, CAP, MON): header and one record per server thread. */
typedef struct klpStatusThread {
  char name[16];  /* 0: thread name, NUL-terminated */
  int32_t kind;   /* 16: KLP_THREAD_KIND_* */
  int32_t state;  /* 20: 1 exists ... 8 is waiting for DB */
} klpStatusThread;

typedef struct klpStatusFmt1 {
  int32_t format; /* 0: 1 */
  int32_t count;  /* 4: records that follow */
  /* klpStatusThread records follow at offset 8 */
} klpStatusFmt1;

enum {
  KLP_THREAD_KIND_OTHER = 0,
  KLP_THREAD_KIND_ADMIN = 1,
  KLP_THREAD_KIND_BEHINDER = 2,
  KLP_THREAD_KIND_BROWSER = 3,
  KLP_THREAD_KIND_BROWSER_A = 4,
  KLP_THREAD_KIND_HOLDL = 5,
  KLP_THREAD_KIND_MONITOR = 6,
  KLP_THREAD_KIND_PRUNE = 7,
  KLP_THREAD_KIND_WORKER = 8,
  KLP_THREAD_KIND_LOGRDR = 9
};

/* Format 2 (KAPP): 1048-byte header, then 12272-byte records. */
typedef struct klpStatusFmt2 {
  int16_t format;    /* 0: 2 */
  int16_t zero;      /* 2: 0 */
  int32_t count;     /* 4: records that follow */
  int32_t value8;    /* 8 */
  char text[1028];   /* 12 */
  int32_t value1040; /* 1040 */
  int32_t value1044; /* 1044 */
} klpStatusFmt2;

typedef struct klpStatusFmt2Record {
  char ident[48];     /* 0 */
  int32_t unused48;   /* 48: left zero */
  int32_t value52;    /* 52 */
  char time56[26];    /* 56 */
  char gap82;
  char block83[64];   /* 83 */
  char gap147;
  char block148[64];  /* 148 */
  char gap212;
  char time213[26];   /* 213 */
  char gap239;
  int32_t value240;   /* 240 */
  int32_t value244;   /* 244 */
  int32_t value248;   /* 248: widened from 16 bits */
  int32_t value252;   /* 252: the four cut from 64 bits */
  int32_t value256;   /* 256 */
  int32_t value260;   /* 260 */
  int32_t value264;   /* 264 */
  char text268[3001]; /* 268 */
  char text3269[3001];
  char text6270[3001];
  char text9271[3001];
} klpStatusFmt2Record;

/* Format 3 (KCAP): one block of 2224 bytes. */
typedef struct klpStatusFmt3 {
  int32_t format;            /* 0: 3 */
  int32_t upTime;            /* 4: seconds */
  char logFile[1028];        /* 8 */
  int32_t activeSubs;        /* 1036 */
  char currentLogTime[27];   /* 1040 */
  char allPublishedLsn[65];  /* 1067 */
  int32_t currentMemory;     /* 1132: bytes */
  char sectionText[1025];    /* 1136 */
  char sectionA[30];         /* 2161 */
  char sectionB[30];         /* 2191 */
  char pad[3];               /* 2221 */
} klpStatusFmt3;

enum {
  KLP_STATUS_FMT1_MIN = 32,     /* 8 + 24 per record, at least one record's room */
  KLP_STATUS_FMT2_MIN = 13320,  /* 1048 + 12272 per record, at least one */
  KLP_STATUS_FMT3_SIZE = 2224
};

/* ---- Exported functions ---------------------------------------------- */

/* Does nothing; answers 0. */
KLP_API int klpStartProgram(void);

/* Sends STOP to the server serverName.schema.KIND. option must not be
 * negative and has no other effect. */
KLP_API int klpStopProgram(int32_t kind, const char* serverName, const char* schema,
                           int32_t option, klpResultBlock* result);

/* Stores in request->statusSize the buffer size klpGetStatus will need. */
KLP_API int klpGetStatusSize(const klpReleaseInfo* release, klpStatusRequest* request,
                             klpResultBlock* result);

/* Fills request->buffer with status data of format 1, 2 or 3 and stores the
 * size it needs in request->requiredSize. */
KLP_API int klpGetStatus(const klpReleaseInfo* release, klpStatusRequest* request,
                         klpResultBlock* result);

#ifdef __cplusplus
}
#endif

#endif /* KLPAPI_H */
