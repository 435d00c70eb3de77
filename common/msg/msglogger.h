// The message logger: one issued message becomes a logMsg record, gets its
// text (built-in table, catalogue, substitution of "$1".."$9"), its severity
// and routing, and is served to its destinations (console, log file, message
// table, generated header). One logger per process; see klplog.h for the
// process-wide issuing functions.
#pragma once

#include <cstdint>
#include <cstdio>
#include <mutex>

#include "common/msg/klplog.h"
#include "common/thread/ordlist.h"

// ---------------------------------------------------------------------------
// Destination bits (routing word and done mask of a record)
// ---------------------------------------------------------------------------
enum : uint16_t {
  MSG_ROUTE_BY_SEVERITY = 1,  // replaced by the logger's word for the severity
  MSG_DEST_STDOUT = 2,        // standard output, always
  MSG_DEST_STDOUT_IF = 4,     // standard output while the console flag is on
  MSG_DEST_LOGFILE = 8,
  MSG_DEST_TABLE = 16,        // database message table (msgLoggerU only)
  MSG_DEST_EXTRA = 32,        // spare; nobody writes it
  MSG_DEST_HEADER = 256,      // generated message header "klpmsgd.h"
};

// Where a record's text came from.
enum : int32_t {
  MSG_SOURCE_NONE = 0,       // internal error (KLP0553W)
  MSG_SOURCE_CATALOG = 1,
  MSG_SOURCE_EXTENSION = 2,  // built-in table, own row
  MSG_SOURCE_OVERRIDE = 3,   // built-in table, row that maps to an external id
};

constexpr int MSG_MAX_VALUES = 9;
constexpr int MSG_DEFAULT_TEXT_SIZE = 1024;
constexpr int MSG_MAX_VALUES_LENGTH = 1161;  // bound on the sum of value lengths
constexpr int MSG_ORIGIN_MAX = 30;
constexpr int MSG_THREAD_NAME_MAX = 15;
constexpr int MSG_QUALIFIER_MAX = 128;
constexpr int MSG_LOG_FILE_NAME_MAX = 1040;
constexpr int MSG_BUCKETS = 100;

// ---------------------------------------------------------------------------
// One issued message. Created per call, freed once its destinations are served.
// ---------------------------------------------------------------------------
struct logMsg {
  OrdListElement ole;                 // lets the record travel on the logger's queue
  uint64_t valueLengths[MSG_MAX_VALUES];
  char* values[MSG_MAX_VALUES];       // separately allocated, NUL-terminated
  uint16_t valueCount;                // 0..9
  char severity;                      // 'E', 'I', 'W', 'D' or ' ' (no id in the text)
  uint16_t doneMask;                  // destination bits already served
  uint16_t routing;                   // destination bits requested
  int32_t msgNumber;                  // external number after an override
  int32_t internalNumber;             // 0, or the number an override replaced
  int32_t extra[2];                   // travel with the message; default -1, -1
  int32_t sourceKind;                 // MSG_SOURCE_*
  char* text;                         // textSize + 1 bytes
  int32_t textSize;
  char origin[MSG_ORIGIN_MAX + 1];
  char threadName[MSG_THREAD_NAME_MAX + 1];
  int64_t timeSeconds;                // UTC
  int32_t timeMicros;
  char timestamp[27];                 // local "%Y-%m-%d-%H.%M.%S.uuuuuu"
  int32_t error;                      // 0, or 801 when an allocation failed
};

// Allocates a record set up as putKlpMsg does (time stamped now, text of
// textSize + 1 bytes, values empty). Null when memory ran out.
logMsg* msgNewRecord(int number, uint16_t routing, const char* origin, const char* threadName,
                     int32_t textSize = MSG_DEFAULT_TEXT_SIZE);
// Frees the record, its text and every value. Null is accepted.
void msgFreeRecord(logMsg* record);

// ---------------------------------------------------------------------------
// Application names (first header value of messages 500-999 and others).
// ---------------------------------------------------------------------------
constexpr int MSG_APPLICATION_COUNT = 18;
constexpr int MSG_APP_KLPKCCMD = 10;
extern const char* const msgApplicationNames[MSG_APPLICATION_COUNT];
// The name of row `index`; "" outside the table.
const char* msgApplicationName(int index);

// ---------------------------------------------------------------------------
// Hooks into higher layers, so the logger does not depend on them.
// ---------------------------------------------------------------------------
// Name of the calling thread's run-time thread object, or null/"" for none.
void msgSetThreadNameProvider(const char* (*provider)());
// String parameter `index` of the program's parameter set, or null.
void msgSetStringParmProvider(const char* (*provider)(int index));
// Inserts one row into the database message table; answers the SQL code
// (0 success). The logger stops trying for 60 s after -968, -289 or -904.
void msgSetTableWriter(int (*writer)(const char* tableName, const char* qualifier,
                                     const logMsg* record));

// The SQL communication area as the database layer hands it to the logger.
struct msgSqlca {
  char sqlcaid[8];
  int32_t sqlcabc;
  int32_t sqlcode;
  int16_t sqlerrml;      // length of sqlerrmc in use
  char sqlerrmc[70];     // error tokens
  char sqlerrp[8];       // error location
  int32_t sqlerrd[6];
  char sqlwarn[11];
  char sqlstate[5];
};

// Hand-over of records to the logger thread in asynchronous mode.
class msgRecordQueue {
 public:
  virtual ~msgRecordQueue() = default;
  // 0 when the record is now owned by the queue.
  virtual int put(logMsg* record) = 0;
  // Takes one record, waiting up to `wait` queue wait units; null when none
  // came. *remaining receives the count left on the queue.
  virtual logMsg* take(int32_t wait, int* remaining) = 0;
};

// ---------------------------------------------------------------------------
// The logger
// ---------------------------------------------------------------------------
class msgLogger {
 public:
  msgLogger(int applicationIndex, int asynchronous);
  virtual ~msgLogger();
  msgLogger(const msgLogger&) = delete;
  msgLogger& operator=(const msgLogger&) = delete;

  // Virtual operations, in slot order.
  virtual void stopLogging();                                           // 0
  virtual void restartLogging(const char* origin);                      // 1
  virtual const char* setLogFileName(const char* directory, const char* fileName);  // 2
  virtual const char* setMsgTableName(const char* schema, const char* table);       // 3
  virtual void clearLog();                                              // 4
  virtual FILE* openLog();                                              // 5
  virtual int getCatalogMsg(int number, int size, char* text);          // 6
  virtual int writeLog(const char* line, int length);                   // 7
  virtual void writeStderr(logMsg* record);                             // 8
  virtual void setRouting(logMsg* record);                              // 9
  virtual void writeConsole(logMsg* record);                            // 10
  virtual void writeLogFile(logMsg* record);                            // 11
  virtual void writeMsgHeader(logMsg* record);                          // 12
  virtual void writeMsgTable(logMsg* record);                           // 13
  virtual void writeExtra(logMsg* record);                              // 14
  virtual const char* setCatalogName();                                 // 15
  virtual const char* defaultThreadName();                              // 16
  virtual const char* getSqlMsgText();                                  // 17
  virtual const char* formatSqlError(char* buffer, int bufferLength, const msgSqlca* sqlca,
                                     const char* statement);            // 18
  virtual void composeKlpMsg(logMsg* record);                           // 19

  // Issues one message. Missing values are stored as "*". Answers 0, or 801
  // when the message was lost for want of memory.
  int putKlpMsg(int number, uint16_t routing, const char* origin, const char* threadName,
                const char* v1 = nullptr, const char* v2 = nullptr, const char* v3 = nullptr,
                const char* v4 = nullptr, const char* v5 = nullptr, const char* v6 = nullptr,
                const char* v7 = nullptr, const char* v8 = nullptr, const char* v9 = nullptr,
                int32_t extra1 = -1, int32_t extra2 = -1);
  // Same with the values as an array of `count` (at most 9 are taken; the
  // rest up to 9 are stored as `pad`, which may be null for "*").
  int putKlpMsgV(int number, uint16_t routing, const char* origin, const char* threadName,
                 int count, const char* const* values, const char* pad = nullptr,
                 int32_t extra1 = -1, int32_t extra2 = -1);

  // Composes as putKlpMsg does but serves no destination: at most
  // bufferLength - 1 characters and a NUL go to buffer (text size is
  // bufferLength, or 1024 when 0). Answers the length copied; on a memory
  // failure the buffer is empty and the answer is -1.
  int getKlpMsgText(int number, const char* origin, const char* threadName, char* buffer,
                    int bufferLength, const char* v1 = nullptr, const char* v2 = nullptr,
                    const char* v3 = nullptr, const char* v4 = nullptr, const char* v5 = nullptr,
                    const char* v6 = nullptr, const char* v7 = nullptr, const char* v8 = nullptr,
                    const char* v9 = nullptr);
  int getKlpMsgTextV(int number, const char* origin, const char* threadName, char* buffer,
                     int bufferLength, int count, const char* const* values,
                     const char* pad = nullptr);

  // Asynchronous mode: takes one queued record (waiting up to `wait` queue
  // units), serves destinations 8, 16, 32, 256 and frees it. Answers the
  // count left on the queue, or -1 when nothing was taken.
  int serveQueuedMsg(int32_t wait);
  // Installs the queue asynchronous mode hands records to (the logger owns it).
  void setRecordQueue(msgRecordQueue* queue);

  // Built-in message table (100 buckets keyed by number modulo 100).
  int loadBuiltinMsgs(const char* const* table);
  int addBuiltinMsg(const char* definition);
  int lookupBuiltinMsg(int number, int size, logMsg* record);
  // Stores the caller's values, the default thread name and the header
  // values, then bounds the total value length.
  // A null value is stored as "*".
  void setMsgValues(logMsg* record, int count, const char* const* values);
  void substituteValues(logMsg* record);

  // Settings filled in by the other layers.
  void setConsoleFlag(int on) { consoleFlag_ = on ? 1 : 0; }
  int getConsoleFlag() const { return consoleFlag_; }
  void setProgramQualifier(const char* qualifier);  // cut to 128 characters
  const char* getProgramQualifier() const { return qualifier_; }
  void setApplicationIndex(int index) { applicationIndex_ = index; }
  int getApplicationIndex() const { return applicationIndex_; }
  const char* getApplicationName() const { return msgApplicationName(applicationIndex_); }
  const char* getLogFileName() const { return logFileName_; }
  const char* getMsgTableName() const { return msgTableName_; }
  const char* getCatalogName() const { return catalogName_; }
  int isAsynchronous() const { return asynchronous_; }
  int isFileOutputEnabled() const { return fileOutput_; }
  // Routing word for severity 'I', 'W', 'E' or anything else.
  uint16_t getRoutingWord(char severity) const;
  void setRoutingWord(char severity, uint16_t word);

 protected:
  void composeWithValues(logMsg* r, int count, const char* const* values, const char* pad);
  // Header values by number range, then the 1161 bound.
  void addHeaderValues(logMsg* record);
  void boundValues(logMsg* record);
  // Fills the KLP0553W text for a number found nowhere.
  void composeInternalError(logMsg* record);
  // The qualifier-and-thread header value for a thread name.
  void qualifierAndThread(const char* threadName, char* out, size_t outLen) const;
  // Serves file-side destinations 8, 16, 32, 256 of one record.
  void serveFileDestinations(logMsg* record, bool requireFileOutput);
  void readSeverity(logMsg* record);
  int issue(logMsg* record);

  uint16_t routingWords_[4];  // 'I', 'W', 'E', other
  char openMode_[4];
  FILE* logStream_ = nullptr;
  // Threads of a server log at once: one line's open, write and close must
  // not interleave with another's on the shared stream pointer.
  std::recursive_mutex logFileLock_;
  int32_t catalogFailureReported_ = 0;
  int32_t openFailureReported_ = 0;
  char logFileName_[MSG_LOG_FILE_NAME_MAX + 1];
  char catalogName_[MSG_LOG_FILE_NAME_MAX + 1];
  int32_t applicationIndex_;
  char msgTableName_[2 * MSG_QUALIFIER_MAX + 2];
  char qualifier_[MSG_QUALIFIER_MAX + 1];
  int32_t consoleFlag_ = 0;
  msgRecordQueue* queue_ = nullptr;
  int32_t asynchronous_;
  int32_t fileOutput_ = 1;
  struct BuiltinNode {
    BuiltinNode* next;
    const char* definition;
  };
  BuiltinNode* buckets_[MSG_BUCKETS];
};

// The logger with the message catalogue, the database message table and the
// run-time thread name as default.
class msgLoggerU : public msgLogger {
 public:
  msgLoggerU(int applicationIndex, int asynchronous);
  void writeMsgTable(logMsg* record) override;
  const char* setCatalogName() override;
  const char* defaultThreadName() override;
  const char* getSqlMsgText() override;
  void composeKlpMsg(logMsg* record) override;

 private:
  int64_t tableQuietUntil_ = 0;  // UTC seconds; table writes paused until then
};

// Builds a msgLoggerU (catalogue "vdbklp.mo", routing 28, 26, 26, 8); null
// when memory ran out.
msgLogger* createMsgLoggerU(int applicationIndex, int asynchronous);

// The built-in message table of the command program (null-terminated).
extern const char* const builtinMsgTable[];

// Closes the generated header "klpmsgd.h" (written in the current
// directory) so that the next use starts a new file.
void msgCloseMsgHeader();

// Base name of a program's log file: "%.8s.%.8s.%s.LOG" of the name's three
// '.'-separated parts (underscores removed) when path begins "//", else
// "%s.log". Answers false (out empty) when no name can be formed or it does
// not fit outLen.
bool msgLogBaseName(const char* path, const char* name, char* out, size_t outLen);

// ---------------------------------------------------------------------------
// Process-wide issuing beyond klplog.h
// ---------------------------------------------------------------------------
// Issues the message and also composes it into buffer: a 16-bit length then
// at most bufferChars - 1 characters and a NUL.
int logKlpMsgAndText(int number, const char* origin, int destKind, char* buffer,
                     uint16_t bufferChars, const char* firstValue, int count, ...);
// Message 552 (and 554 for SQL code -964; nothing for -952).
int logSqlError(const msgSqlca* sqlca, const char* origin, int destKind, const char* text1,
                const char* text2, const char* text3);
// Message 574 for reasons 2162, 2161, 2059 when use574 is set, else 575.
int logXqError(int reason, const char* origin, int destKind, int use574, const char* text1,
               const char* text2);

// Replaces "$1".."$9" in ascending order in tmpl (tmplLen characters) by
// values[0..count-1] ("*" for a missing or empty value) and writes at most
// capacity characters and a NUL to out (capacity + 1 bytes). Answers the
// length written.
int msgSubstitute(const char* tmpl, size_t tmplLen, char* const* values, int count, char* out,
                  int capacity);

// ---------------------------------------------------------------------------
// The message catalogue file (GNU MO format)
// ---------------------------------------------------------------------------
constexpr const char* MSG_CATALOG_NAME = "vdbklp.mo";
// Finds the text of `number` in the catalogue `catalogName`, substitutes
// values[0..count-1] for "$1".."$9" and writes at most bufferSize - 1
// characters and a NUL. Answers the text length (> 0), or <= 0 with an error
// text in buffer whose reason is the decimal number three characters after
// its first ':' (2: file missing, 3: unreadable or damaged, 4: no such
// message).
int retrieveCatalogMsg(const char* catalogName, int number, const uint64_t* valueLengths,
                       char* const* values, int count, char* buffer, int bufferSize);
// Forgets the parsed catalogue so that the next call reads the file again.
void msgCatalogReset();
// An in-memory reader of MO images. msgMoParse answers null and sets
// *reason to 3 when the image is damaged; the lookup answers the msgstr
// (length in *len, not NUL-terminated) or null.
struct msgMoCatalog;
msgMoCatalog* msgMoParse(const uint8_t* data, size_t size, int* reason);
const char* msgMoLookup(const msgMoCatalog* catalog, const char* key, size_t* len);
void msgMoFree(msgMoCatalog* catalog);
