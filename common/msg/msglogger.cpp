// The message logger: records, routing, console and log-file destinations.
#include "common/msg/msglogger.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <new>

#include "common/platform/hsv.h"
#include "common/thread/queue.h"
#include "common/util/klprc.h"

const char* const msgApplicationNames[MSG_APPLICATION_COUNT] = {
    "@A",       "Capture",  "Apply",    "KlpCcmd",  "KlpAcmd",   "K Capture",
    "K Apply",  "Klpmon",   "Klppwd",   "KlpMcmd",  "KlpKCcmd",  "KlpKAcmd",
    "KlpTDiff", "KlpKMFmt", "Analyzer", "K Analyzer", "KlpSList", "KlpTRep"};

const char* msgApplicationName(int index) {
  if (index < 0 || index >= MSG_APPLICATION_COUNT) return "";
  return msgApplicationNames[index];
}

namespace {

const char* (*threadNameProvider)() = nullptr;
const char* (*stringParmProvider)(int) = nullptr;
int (*tableWriter)(const char*, const char*, const logMsg*) = nullptr;

// Copies at most max characters of src (null: empty) into dst[max + 1].
void copyCut(char* dst, const char* src, size_t max) {
  size_t n = 0;
  if (src != nullptr) {
    while (n < max && src[n] != '\0') ++n;
    memcpy(dst, src, n);
  }
  dst[n] = '\0';
}

int routingSlot(char severity) {
  switch (severity) {
    case 'I': return 0;
    case 'W': return 1;
    case 'E': return 2;
    default: return 3;
  }
}

void stampTime(logMsg* r) {
  HSVTimeUTC now = hsvTimeGetUTC();
  r->timeSeconds = now.seconds;
  r->timeMicros = now.microseconds;
  struct tm local;
  memset(&local, 0, sizeof local);
  if (!hsvTimeLocalTime(now.seconds, &local)) {
    // Keep a well-formed 26-character stamp even when the conversion fails.
    strcpy(r->timestamp, "0000-00-00-00.00.00.000000");
    return;
  }
  size_t n = strftime(r->timestamp, sizeof r->timestamp, "%Y-%m-%d-%H.%M.%S", &local);
  snprintf(r->timestamp + n, sizeof r->timestamp - n, ".%06d", static_cast<int>(now.microseconds));
}

void reportLost(int number) {
  printf("%s : Failed to log klpMsgId '%d' due to insufficient memory.\n", "msgLogger::putKlpMsg",
         number);
  fflush(stdout);
}

// Records travel to the logger thread on a wait/post queue: put at the tail,
// taken from the head, so they are served in the order they were issued.
class waitPostRecordQueue : public msgRecordQueue {
 public:
  ~waitPostRecordQueue() override {
    // A create failure was already reported by the queue itself.
    if (queue_.createRc == 0 && queue_.waitpost.destroy() != 0) {
      printf("unknown wait/post destroy error\n");
      fflush(stdout);
    }
  }
  int put(logMsg* record) override { return queue_.putTailAndNotify(&record->ole); }
  logMsg* take(int32_t wait, int* remaining) override {
    int32_t waitMs = wait;
    OrdListElement* e = queue_.getHeadWithWait(&waitMs);
    if (remaining != nullptr) *remaining = queue_.getCount();
    return e != nullptr ? static_cast<logMsg*>(e->object) : nullptr;
  }

 private:
  Queue queue_;
};

}  // namespace

void msgSetThreadNameProvider(const char* (*provider)()) { threadNameProvider = provider; }
void msgSetStringParmProvider(const char* (*provider)(int index)) { stringParmProvider = provider; }
void msgSetTableWriter(int (*writer)(const char*, const char*, const logMsg*)) {
  tableWriter = writer;
}

// ---------------------------------------------------------------------------
// Records
// ---------------------------------------------------------------------------
logMsg* msgNewRecord(int number, uint16_t routing, const char* origin, const char* threadName,
                     int32_t textSize) {
  logMsg* r = new (std::nothrow) logMsg();
  if (r == nullptr) return nullptr;
  r->ole.size = sizeof(logMsg);
  r->ole.object = r;
  r->severity = ' ';
  r->textSize = textSize > 0 ? textSize : MSG_DEFAULT_TEXT_SIZE;
  r->routing = routing;
  r->msgNumber = number;
  r->extra[0] = -1;
  r->extra[1] = -1;
  copyCut(r->origin, origin, MSG_ORIGIN_MAX);
  copyCut(r->threadName, threadName, MSG_THREAD_NAME_MAX);
  stampTime(r);
  r->text = new (std::nothrow) char[static_cast<size_t>(r->textSize) + 1];
  if (r->text == nullptr)
    r->error = KLP_RC_NO_MEMORY;
  else
    r->text[0] = '\0';
  return r;
}

void msgFreeRecord(logMsg* record) {
  if (record == nullptr) return;
  for (int i = 0; i < MSG_MAX_VALUES; ++i) delete[] record->values[i];
  delete[] record->text;
  delete record;
}

// ---------------------------------------------------------------------------
// Logger
// ---------------------------------------------------------------------------
msgLogger::msgLogger(int applicationIndex, int asynchronous)
    : applicationIndex_(applicationIndex), asynchronous_(asynchronous) {
  routingWords_[0] = 12;
  routingWords_[1] = 12;
  routingWords_[2] = 10;
  routingWords_[3] = 8;
  strcpy(openMode_, "a");
  logFileName_[0] = '\0';
  catalogName_[0] = '\0';
  msgTableName_[0] = '\0';
  qualifier_[0] = '\0';
  for (auto& b : buckets_) b = nullptr;
  queue_ = new (std::nothrow) waitPostRecordQueue;
}

msgLogger::~msgLogger() {
  if (queue_ != nullptr) {
    // Records still queued belong to us; serve nothing more, just free them.
    int remaining = 0;
    while (logMsg* r = queue_->take(0, &remaining)) msgFreeRecord(r);
    delete queue_;
    queue_ = nullptr;
  }
  if (logStream_ != nullptr) fclose(logStream_);
  for (auto& b : buckets_) {
    while (b != nullptr) {
      BuiltinNode* next = b->next;
      delete b;
      b = next;
    }
  }
}

void msgLogger::setRecordQueue(msgRecordQueue* queue) {
  delete queue_;
  queue_ = queue;
}

void msgLogger::setProgramQualifier(const char* qualifier) {
  copyCut(qualifier_, qualifier, MSG_QUALIFIER_MAX);
}

uint16_t msgLogger::getRoutingWord(char severity) const {
  return routingWords_[routingSlot(severity)];
}
void msgLogger::setRoutingWord(char severity, uint16_t word) {
  routingWords_[routingSlot(severity)] = word;
}

void msgLogger::serveFileDestinations(logMsg* r, bool requireFileOutput) {
  if (requireFileOutput && !fileOutput_) return;
  if ((r->routing & MSG_DEST_LOGFILE) && logFileName_[0] != '\0') writeLogFile(r);
  if ((r->routing & MSG_DEST_TABLE) && msgTableName_[0] != '\0') writeMsgTable(r);
  if (r->routing & MSG_DEST_EXTRA) writeExtra(r);
  if (r->routing & MSG_DEST_HEADER) writeMsgHeader(r);
}

void msgLogger::stopLogging() {
  fileOutput_ = 0;
  if (queue_ != nullptr) {
    int remaining = 0;
    while (logMsg* r = queue_->take(10, &remaining)) {
      serveFileDestinations(r, false);
      msgFreeRecord(r);
    }
  }
  std::lock_guard<std::recursive_mutex> hold(logFileLock_);
  if (logStream_ != nullptr) {
    fclose(logStream_);
    logStream_ = nullptr;
  }
}

void msgLogger::restartLogging(const char* origin) {
  fileOutput_ = 1;
  putKlpMsg(8999, MSG_ROUTE_BY_SEVERITY, origin, " ", "Message logging re-enabled");
}

const char* msgLogger::setLogFileName(const char* directory, const char* fileName) {
  const char* dir = directory != nullptr ? directory : "";
  const char* file = fileName != nullptr ? fileName : "";
  size_t dl = strlen(dir);
  // An empty directory means the current one: do not turn it into the root.
  const char* sep = (dl == 0 || dir[dl - 1] == '/') ? "" : "/";
  int n = snprintf(logFileName_, sizeof logFileName_, "%s%s%s", dir, sep, file);
  // A cut path would name some other file: rather have no log file.
  if (n < 0 || static_cast<size_t>(n) >= sizeof logFileName_) logFileName_[0] = '\0';
  return logFileName_;
}

const char* msgLogger::setMsgTableName(const char* schema, const char* table) {
  snprintf(msgTableName_, sizeof msgTableName_, "%.128s.%.128s", schema ? schema : "",
           table ? table : "");
  return msgTableName_;
}

void msgLogger::clearLog() {
  std::lock_guard<std::recursive_mutex> hold(logFileLock_);
  if (logStream_ != nullptr) {
    fclose(logStream_);
    logStream_ = nullptr;
  }
  if (logFileName_[0] == '\0') return;
  if (FILE* f = fopen(logFileName_, "w")) fclose(f);
}

FILE* msgLogger::openLog() {
  if (logFileName_[0] == '\0') return nullptr;
  logStream_ = fopen(logFileName_, openMode_);
  if (logStream_ != nullptr) return logStream_;
  int err = errno;
  if (openFailureReported_) return nullptr;
  logMsg* r = msgNewRecord(514, 0, "msgLogger::openLog", "Initial");
  if (r != nullptr && r->text != nullptr) {
    char qt[MSG_QUALIFIER_MAX + 32];
    qualifierAndThread("Initial", qt, sizeof qt);
    snprintf(r->text, static_cast<size_t>(r->textSize) + 1,
             "%s KLP0514E \"%s\" : \"%s\" :  The program could not open the log file named "
             "\"%s\", reason: \"%s\"",
             r->timestamp, getApplicationName(), qt, logFileName_, strerror(err));
    r->severity = 'E';
    writeStderr(r);
  }
  msgFreeRecord(r);
  openFailureReported_ = 1;
  return nullptr;
}

int msgLogger::getCatalogMsg(int, int, char*) { return 0; }

int msgLogger::writeLog(const char* line, int length) {
  if (logStream_ == nullptr) return -1;
  FILE* f = logStream_;
  logStream_ = nullptr;
  if (line == nullptr || length < 0) length = 0;
  size_t put = length > 0 ? fwrite(line, 1, static_cast<size_t>(length), f) : 0;
  int nl = fputc('\n', f);
  // The line only counts as written once it reached the file.
  int closed = fclose(f);
  if (put != static_cast<size_t>(length) || nl == EOF || closed != 0) return -1;
  return length + 1;
}

void msgLogger::writeStderr(logMsg* record) {
  fprintf(stderr, "%s\n", record->text != nullptr ? record->text : "");
  fflush(stderr);
}

void msgLogger::setRouting(logMsg* r) {
  uint16_t mask = consoleFlag_ ? 0xFFFF : static_cast<uint16_t>(~MSG_DEST_STDOUT_IF);
  uint16_t added = 0;
  uint16_t routing = r->routing;
  if (routing & MSG_ROUTE_BY_SEVERITY) {
    routing = static_cast<uint16_t>(routing & ~MSG_ROUTE_BY_SEVERITY);
    added = routingWords_[routingSlot(r->severity)];
  }
  r->routing = static_cast<uint16_t>((routing | added) & mask);
}

void msgLogger::writeConsole(logMsg* r) {
  if (r->doneMask & (MSG_DEST_STDOUT | MSG_DEST_STDOUT_IF)) return;
  r->doneMask |= MSG_DEST_STDOUT | MSG_DEST_STDOUT_IF;
  printf("%s %s\n", r->timestamp, r->text != nullptr ? r->text : "");
  fflush(stdout);
}

void msgLogger::writeLogFile(logMsg* r) {
  if (r->doneMask & MSG_DEST_LOGFILE) return;
  r->doneMask |= MSG_DEST_LOGFILE;
  if (logFileName_[0] == '\0') return;
  std::lock_guard<std::recursive_mutex> hold(logFileLock_);
  if (logStream_ == nullptr) openLog();
  if (logStream_ == nullptr) return;
  const char* text = r->text != nullptr ? r->text : "";
  size_t cap = strlen(r->timestamp) + strlen(r->origin) + strlen(text) + 8;
  char* line = new (std::nothrow) char[cap];
  if (line == nullptr) {
    fclose(logStream_);
    logStream_ = nullptr;
    writeStderr(r);
    return;
  }
  int len = snprintf(line, cap, "%s <%s> %s", r->timestamp, r->origin, text);
  int count = writeLog(line, len);
  delete[] line;
  if (count < 0)
    writeStderr(r);
  else
    openFailureReported_ = 0;
}

void msgLogger::writeMsgTable(logMsg* r) { r->doneMask |= MSG_DEST_TABLE; }

void msgLogger::writeExtra(logMsg*) {}

const char* msgLogger::setCatalogName() {
  catalogName_[0] = '\0';
  return catalogName_;
}

const char* msgLogger::defaultThreadName() { return ""; }

const char* msgLogger::getSqlMsgText() { return " "; }

const char* msgLogger::formatSqlError(char* buffer, int bufferLength, const msgSqlca* sqlca,
                                      const char* statement) {
  if (buffer == nullptr || bufferLength <= 0) return buffer;
  size_t cap = static_cast<size_t>(bufferLength);
  if (sqlca == nullptr)
    snprintf(buffer, cap, "DB Error");
  else if (statement == nullptr)
    snprintf(buffer, cap, "SQL returned sqlcode %d", sqlca->sqlcode);
  else
    snprintf(buffer, cap, "SQL Statement '%s' returned sqlcode %d", statement, sqlca->sqlcode);
  return buffer;
}

void msgLogger::qualifierAndThread(const char* threadName, char* out, size_t outLen) const {
  snprintf(out, outLen, "%s\" : \"%s", qualifier_, threadName != nullptr ? threadName : "");
}

void msgLogger::readSeverity(logMsg* r) {
  r->severity = ' ';
  if (r->text == nullptr || r->msgNumber < 0 || r->msgNumber > 9999) return;
  char id[8];
  snprintf(id, sizeof id, "KLP%04d", r->msgNumber);
  char* at = strstr(r->text, id);
  if (at == nullptr) return;
  char c = at[7];
  switch (c) {
    case 'E': case 'I': case 'W':
      r->severity = c;
      break;
    case 'e': case 'i': case 'w':
      r->severity = static_cast<char>(c - 'a' + 'A');
      at[7] = r->severity;
      break;
    default:
      r->severity = 'D';
  }
}

// Serves a composed record; takes ownership of it.
int msgLogger::issue(logMsg* r) {
  readSeverity(r);
  setRouting(r);
  if (r->routing & (MSG_DEST_STDOUT | MSG_DEST_STDOUT_IF)) writeConsole(r);
  if (asynchronous_ && fileOutput_ && queue_ != nullptr) {
    if (queue_->put(r) == 0) return 0;
    // The queue refused it: serve it here rather than lose it.
  }
  serveFileDestinations(r, true);
  msgFreeRecord(r);
  return 0;
}

int msgLogger::putKlpMsg(int number, uint16_t routing, const char* origin, const char* threadName,
                         const char* v1, const char* v2, const char* v3, const char* v4,
                         const char* v5, const char* v6, const char* v7, const char* v8,
                         const char* v9, int32_t extra1, int32_t extra2) {
  const char* values[MSG_MAX_VALUES] = {v1, v2, v3, v4, v5, v6, v7, v8, v9};
  return putKlpMsgV(number, routing, origin, threadName, MSG_MAX_VALUES, values, nullptr, extra1,
                    extra2);
}

// Stores the caller's values, padded to nine with `pad`, and composes the
// text; the record's error tells whether it worked.
void msgLogger::composeWithValues(logMsg* r, int count, const char* const* values,
                                  const char* pad) {
  const char* all[MSG_MAX_VALUES];
  if (count < 0 || values == nullptr) count = 0;
  for (int i = 0; i < MSG_MAX_VALUES; ++i) all[i] = i < count ? values[i] : pad;
  setMsgValues(r, MSG_MAX_VALUES, all);
  if (r->error == 0) composeKlpMsg(r);
}

int msgLogger::putKlpMsgV(int number, uint16_t routing, const char* origin,
                          const char* threadName, int count, const char* const* values,
                          const char* pad, int32_t extra1, int32_t extra2) {
  logMsg* r = msgNewRecord(number, routing, origin, threadName);
  if (r == nullptr || r->error != 0) {
    reportLost(number);
    msgFreeRecord(r);
    return KLP_RC_NO_MEMORY;
  }
  r->extra[0] = extra1;
  r->extra[1] = extra2;
  composeWithValues(r, count, values, pad);
  if (r->error != 0) {
    reportLost(number);
    msgFreeRecord(r);
    return KLP_RC_NO_MEMORY;
  }
  return issue(r);
}

int msgLogger::getKlpMsgText(int number, const char* origin, const char* threadName,
                             char* buffer, int bufferLength, const char* v1, const char* v2,
                             const char* v3, const char* v4, const char* v5, const char* v6,
                             const char* v7, const char* v8, const char* v9) {
  const char* values[MSG_MAX_VALUES] = {v1, v2, v3, v4, v5, v6, v7, v8, v9};
  return getKlpMsgTextV(number, origin, threadName, buffer, bufferLength, MSG_MAX_VALUES, values);
}

int msgLogger::getKlpMsgTextV(int number, const char* origin, const char* threadName,
                              char* buffer, int bufferLength, int count,
                              const char* const* values, const char* pad) {
  if (buffer != nullptr && bufferLength > 0) buffer[0] = '\0';
  logMsg* r = msgNewRecord(number, 0, origin, threadName,
                           bufferLength > 0 ? bufferLength : MSG_DEFAULT_TEXT_SIZE);
  if (r == nullptr || r->error != 0) {
    msgFreeRecord(r);
    return -1;
  }
  composeWithValues(r, count, values, pad);
  if (r->error != 0) {
    msgFreeRecord(r);
    return -1;
  }
  readSeverity(r);
  int copied = 0;
  if (buffer != nullptr && bufferLength > 0) {
    size_t n = strlen(r->text);
    if (n > static_cast<size_t>(bufferLength - 1)) n = static_cast<size_t>(bufferLength - 1);
    memcpy(buffer, r->text, n);
    buffer[n] = '\0';
    copied = static_cast<int>(n);
  }
  msgFreeRecord(r);
  return copied;
}

int msgLogger::serveQueuedMsg(int32_t wait) {
  if (queue_ == nullptr) return -1;
  int remaining = 0;
  logMsg* r = queue_->take(wait, &remaining);
  if (r == nullptr) return -1;
  serveFileDestinations(r, false);
  msgFreeRecord(r);
  return remaining;
}

// ---------------------------------------------------------------------------
// msgLoggerU
// ---------------------------------------------------------------------------
msgLoggerU::msgLoggerU(int applicationIndex, int asynchronous)
    : msgLogger(applicationIndex, asynchronous) {
  setCatalogName();
  routingWords_[0] = 28;
  routingWords_[1] = 26;
  routingWords_[2] = 26;
  routingWords_[3] = 8;
}

const char* msgLoggerU::setCatalogName() {
  copyCut(catalogName_, MSG_CATALOG_NAME, MSG_LOG_FILE_NAME_MAX);
  return catalogName_;
}

const char* msgLoggerU::defaultThreadName() {
  const char* name = threadNameProvider != nullptr ? threadNameProvider() : nullptr;
  return name != nullptr ? name : "";
}

const char* msgLoggerU::getSqlMsgText() {
  int index = -1;
  if (applicationIndex_ == 5) index = 29;
  if (applicationIndex_ == 6) index = 17;
  if (index < 0 || stringParmProvider == nullptr) return "";
  const char* text = stringParmProvider(index);
  return text != nullptr ? text : "";
}

void msgLoggerU::writeMsgTable(logMsg* r) {
  if (r->doneMask & MSG_DEST_TABLE) return;
  r->doneMask |= MSG_DEST_TABLE;
  if (tableWriter == nullptr || msgTableName_[0] == '\0') return;
  HSVTimeUTC now = hsvTimeGetUTC();
  if (now.seconds < tableQuietUntil_) return;
  char qualifier[24];
  snprintf(qualifier, sizeof qualifier, "%-18.18s", qualifier_);
  int sqlcode = tableWriter(msgTableName_, qualifier, r);
  // The database or the table is gone: stop hammering it for a while.
  if (sqlcode == -968 || sqlcode == -289 || sqlcode == -904) tableQuietUntil_ = now.seconds + 60;
}

msgLogger* createMsgLoggerU(int applicationIndex, int asynchronous) {
  return new (std::nothrow) msgLoggerU(applicationIndex, asynchronous);
}

// ---------------------------------------------------------------------------
// Log file base names
// ---------------------------------------------------------------------------
bool msgLogBaseName(const char* path, const char* name, char* out, size_t outLen) {
  if (out == nullptr || outLen == 0) return false;
  out[0] = '\0';
  if (name == nullptr) return false;
  int n;
  if (path != nullptr && strncmp(path, "//", 2) == 0) {
    char clean[MSG_LOG_FILE_NAME_MAX + 1];
    size_t k = 0;
    for (const char* p = name; *p != '\0' && k < sizeof clean - 1; ++p)
      if (*p != '_') clean[k++] = *p;
    clean[k] = '\0';
    char* dot1 = strchr(clean, '.');
    if (dot1 == nullptr) return false;
    char* dot2 = strchr(dot1 + 1, '.');
    if (dot2 == nullptr) return false;
    *dot1 = '\0';
    *dot2 = '\0';
    n = snprintf(out, outLen, "%.8s.%.8s.%s.LOG", clean, dot1 + 1, dot2 + 1);
  } else {
    n = snprintf(out, outLen, "%s.log", name);
  }
  if (n < 0 || static_cast<size_t>(n) >= outLen) {
    out[0] = '\0';
    return false;
  }
  return true;
}
