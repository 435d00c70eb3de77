// The labelled status reports of STATUS SHOW DETAILS: one line per item,
// "  label ... (KEYWORD) = value", all " = " in one column.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>

// Full report: server, schema and the status data of format 3 (2224 bytes).
void klpPrintFullStatus(const char* server, const char* schema, const void* status, int quiet);
// Short report (the collector failed): server, schema, status text 7124.
void klpPrintShortStatus(const char* server, const char* schema, const void* status, int quiet);
// Not-available report (no reply in time): server, schema, status 7193.
void klpPrintNotAvailableStatus(const char* server, const char* schema, const void* status,
                                int quiet);

// One report row as it is printed.
struct klpReportRow {
  int labelMsg;         // catalogue number of the label
  std::string label;    // filled from the catalogue when printed
  const char* keyword;  // fixed
  std::string value;
};

// The text of a catalogue message without its id and the blanks after it
// (the first 10 characters), as the reports show labels and status words.
std::string klpCatalogLabel(int msgNumber);

// Builds the report lines of rows (labels already filled): width W = indent
// + max(label + keyword + 6); ")" at W-4, " = " at W-3..W-1, then the value;
// a line holds at most W + 3000 characters.
void klpFormatReport(const klpReportRow* rows, size_t count, int indent, std::string* lines);

// Up time in seconds as "%3dd %2dh %2dm %2ds".
std::string klpFormatUpTime(int32_t seconds);
