#include "xqpub/statusreport.h"

#include <cstdio>
#include <cstring>

#include "common/msg/klplog.h"
#include "common/util/klpfmt.h"
#include "include/klpapi.h"

namespace {

constexpr int kIndent = 2;
constexpr size_t kValueRoom = 3000;
constexpr size_t kIdWidth = 10;  // "KLPnnnnX" and two blanks

// Catalogue numbers of the labels and status words.
enum : int {
  MSG_SERVER = 7112,
  MSG_SCHEMA = 7113,
  MSG_STATUS = 7114,
  MSG_UP_TIME = 7115,
  MSG_LOGFILE = 7116,
  MSG_ACTIVE_KSUBS = 7117,
  MSG_CURRENT_LOG_TIME = 7119,
  MSG_ALL_PUBLISHED = 7120,
  MSG_CURRENT_MEMORY = 7121,
  MSG_HEADING = 7122,
  MSG_STATUS_UP = 7123,
  MSG_STATUS_UNKNOWN = 7124,
  MSG_NOT_AVAILABLE = 7193,
};

std::string fieldText(const char* field, size_t width) {
  return std::string(field, strnlen(field, width));
}

void printReport(klpReportRow* rows, size_t count, int quiet) {
  if (quiet) return;
  std::string heading = klpCatalogLabel(MSG_HEADING);
  std::printf("%s\n", heading.c_str());
  for (size_t i = 0; i < count; ++i) rows[i].label = klpCatalogLabel(rows[i].labelMsg);
  std::string* lines = new std::string[count];
  klpFormatReport(rows, count, kIndent, lines);
  for (size_t i = 0; i < count; ++i) std::printf("%s\n", lines[i].c_str());
  std::fflush(stdout);
  delete[] lines;
}

std::string orEmpty(const char* s) { return s ? std::string(s) : std::string(); }

}  // namespace

std::string klpCatalogLabel(int msgNumber) {
  // The text is captured, not printed: the catalogue is only the source of
  // the words here.
  char buffer[2 + 1024 + 1];
  std::memset(buffer, 0, sizeof(buffer));
  klpMsgCtx ctx{};
  ctx.wantText = 1;
  ctx.bufferChars = 1024;
  ctx.buffer = buffer;
  logKlpMsg(msgNumber, "N/A", KLP_DEST_CONSOLE, nullptr, &ctx, 0);
  uint16_t len;
  std::memcpy(&len, buffer, sizeof(len));
  if (len > 1024) len = 1024;
  const char* text = buffer + 2;
  size_t n = strnlen(text, len);
  if (n <= kIdWidth) return std::string();
  return std::string(text + kIdWidth, n - kIdWidth);
}

void klpFormatReport(const klpReportRow* rows, size_t count, int indent, std::string* lines) {
  size_t widest = 0;
  for (size_t i = 0; i < count; ++i) {
    size_t w = rows[i].label.size() + std::strlen(rows[i].keyword) + 6;
    if (w > widest) widest = w;
  }
  const size_t width = static_cast<size_t>(indent) + widest;
  for (size_t i = 0; i < count; ++i) {
    std::string line(width, ' ');
    line.replace(static_cast<size_t>(indent), rows[i].label.size(), rows[i].label);
    std::string kw = std::string("(") + rows[i].keyword + ")";
    // ")" ends at W-4, so the parenthesised keyword starts W-4-(len-1).
    line.replace(width - 3 - kw.size(), kw.size(), kw);
    line.replace(width - 3, 3, " = ");
    line += rows[i].value.substr(0, kValueRoom);
    lines[i] = std::move(line);
  }
}

std::string klpFormatUpTime(int32_t seconds) {
  char buf[64] = {0};
  if (formatDuration(seconds, buf, sizeof(buf)) < 0) buf[0] = '\0';
  return buf;
}

void klpPrintFullStatus(const char* server, const char* schema, const void* status, int quiet) {
  if (quiet) return;
  klpStatusFmt3 data;
  std::memset(&data, 0, sizeof(data));
  if (status) std::memcpy(&data, status, sizeof(data));
  char number[32];
  klpReportRow rows[9] = {
      {MSG_SERVER, "", "SERVER", orEmpty(server)},
      {MSG_SCHEMA, "", "SCHEMA", orEmpty(schema)},
      {MSG_STATUS, "", "STATUS", klpCatalogLabel(MSG_STATUS_UP)},
      {MSG_UP_TIME, "", "UP_TIME", klpFormatUpTime(data.upTime)},
      {MSG_LOGFILE, "", "LOGFILE", fieldText(data.logFile, sizeof(data.logFile))},
      {MSG_ACTIVE_KSUBS, "", "ACTIVE_KSUBS", ""},
      {MSG_CURRENT_LOG_TIME, "", "CURRENT_LOG_TIME",
       fieldText(data.currentLogTime, sizeof(data.currentLogTime))},
      {MSG_ALL_PUBLISHED, "", "ALL_PUBLISHED_AS_OF_LSN",
       fieldText(data.allPublishedLsn, sizeof(data.allPublishedLsn))},
      {MSG_CURRENT_MEMORY, "", "CURRENT_MEMORY ", ""},
  };
  std::snprintf(number, sizeof(number), "%d", data.activeSubs);
  rows[5].value = number;
  std::snprintf(number, sizeof(number), "%d bytes", data.currentMemory);
  rows[8].value = number;
  printReport(rows, 9, quiet);
}

void klpPrintShortStatus(const char* server, const char* schema, const void*, int quiet) {
  if (quiet) return;
  klpReportRow rows[3] = {
      {MSG_SERVER, "", "SERVER", orEmpty(server)},
      {MSG_SCHEMA, "", "SCHEMA", orEmpty(schema)},
      {MSG_STATUS, "", "STATUS", klpCatalogLabel(MSG_STATUS_UNKNOWN)},
  };
  printReport(rows, 3, quiet);
}

void klpPrintNotAvailableStatus(const char* server, const char* schema, const void*,
                                int quiet) {
  if (quiet) return;
  klpReportRow rows[3] = {
      {MSG_SERVER, "", "SERVER", orEmpty(server)},
      {MSG_SCHEMA, "", "SCHEMA", orEmpty(schema)},
      {MSG_NOT_AVAILABLE, "", "STATUS", klpCatalogLabel(MSG_NOT_AVAILABLE)},
  };
  printReport(rows, 3, quiet);
}
