// Formatting and time helpers shared by every program of the product:
// identifiers and log positions, hexadecimal text and dumps, timestamps and
// durations, packed-decimal dates, bounded string copies, the program's own
// files and the wildcard matcher of the transaction-ignore criteria.
//
// Identifier printers come in two forms: into a caller's buffer (answering the
// characters written) and onto standard output. When the text cannot fit, the
// buffer form writes "...buffer full\n" instead when the buffer holds at least
// 17 characters and nothing otherwise (answer 0); never part of an identifier.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstdio>

constexpr size_t KLP_LOGPOS_SIZE = 10;
constexpr const char* KLP_BUFFER_FULL = "...buffer full\n";
constexpr size_t KLP_PRINT_WORK_SIZE = 256;

// ---------------------------------------------------------------------------
// Identifiers
// ---------------------------------------------------------------------------
// Log position as five big-endian 16-bit words: "%04x:%04x:%04x:%04x:%04x".
int formatLogPosWords(char* buf, size_t size, const char* prefix, const uint8_t* logPos,
                      const char* suffix);
void printLogPosWords(const char* prefix, const uint8_t* logPos, const char* suffix);
// Log position as byte pairs: "%02x%02x:..." (the print form adds "\n").
int formatLogPosBytes(char* buf, size_t size, const char* prefix, const uint8_t* logPos,
                      const char* suffix);
void printLogPosBytes(const char* prefix, const uint8_t* logPos, const char* suffix);
// Variable identifier: a signed 16-bit byte count followed by the bytes.
// Printed as byte pairs "%02x%02x" joined by ":"; a pair's missing second
// byte (odd count) and the first pair of a shorter identifier show as "00".
int formatVarId(char* buf, size_t size, const char* prefix, const void* varId,
                const char* suffix);
void printVarId(const char* prefix, const void* varId, const char* suffix);
// Number pair "%04d:%04d".
int formatNumPair(char* buf, size_t size, const char* prefix, uint16_t first, uint16_t second,
                  const char* suffix);
void printNumPair(const char* prefix, uint16_t first, uint16_t second, const char* suffix);
// 8 bytes as 16 lower-case hexadecimal digits in memory order (a log
// sequence number). Answers 16 when written.
int formatLsn(char* buf, size_t size, const char* prefix, const uint8_t* lsn, const char* suffix);
void printLsn(const char* prefix, const uint8_t* lsn, const char* suffix);

// ---------------------------------------------------------------------------
// Hexadecimal text
// ---------------------------------------------------------------------------
// "%02X" per byte of a variable identifier; size must be at least
// 2 x count + 1, else an assertion report and nothing written (answer -1).
// Answers the characters written.
int formatHex(const void* varId, char* buf, size_t size);
// "%02X" per byte of n bytes and a NUL; -1 (nothing written) when size is
// below 2n + 1. Answers 2n.
int formatHexUpper(const void* data, size_t n, char* buf, size_t size);
// Hex dump: 20 bytes per line, optional address column, bytes and characters.
void hexDump(size_t count, const void* addr, FILE* stream, bool showAddress);

// ---------------------------------------------------------------------------
// Timestamps
// ---------------------------------------------------------------------------
constexpr size_t KLP_TIMESTAMP_LEN = 19;       // "%Y-%m-%d-%H.%M.%S"
constexpr size_t KLP_TIMESTAMP_US_LEN = 26;    // with ".%06d"
constexpr size_t KLP_TIMESTAMP_BUF = 40;       // enough for every timestamp form

// Local-time text "YYYY-MM-DD-hh.mm.ss[.uuuuuu]" to seconds. Answers 0, or -1
// after message 8999 (wrong length, or mktime failed; *seconds is then 0).
int timestamp2seconds(const char* text, int64_t* seconds, int32_t* micros);
// Local timestamp: "Un-initialized" for seconds 0 without iso, else ISO
// "YYYY-MM-DDThh:mm:ss[.uuuuuu]" or "MM-DD-YYYY hh:mm:ss[.uuuuuu]".
// Answers the characters written (cut to size - 1).
int formatLocalTimestamp(int64_t seconds, int32_t micros, char* buf, size_t size, bool iso);
// UTC timestamp in style 'C', 'X' or 'D'; another style writes nothing.
int formatUtcTimestamp(int64_t seconds, int32_t micros, char* buf, size_t size, char style);
// Seconds to local "%Y-%m-%d-%H.%M.%S"; out holds 20 bytes.
void secondsToTimestamp(int64_t seconds, char* out);
// Packed-decimal date (4 bytes) to "YYYY-MM-DD": 10 characters, no NUL.
void bcdDateToText(const uint8_t* bcd, char* out);
// Packed-decimal time (3 bytes) to "hh.mm.ss": 8 characters, no NUL.
void bcdTimeToText(const uint8_t* bcd, char* out);
// Packed-decimal timestamp (7 bytes and bcdLen - 7 fraction bytes) to
// "YYYY-MM-DD-hh.mm.ss" and, with fracLen >= 1, "." and fracLen fraction
// characters: 19 + (fracLen ? 1 + fracLen : 0) characters, no NUL. At most
// `precision` fraction digits are taken (6 unless the environment's program
// version is 9.7 or later) and never beyond bcdLen; the rest show '0'.
// Answers the characters written, or -1 when bcdLen is below 7.
int bcdTimestampToText(const uint8_t* bcd, size_t bcdLen, int fracLen, int precision, char* out);

// ---------------------------------------------------------------------------
// Durations
// ---------------------------------------------------------------------------
// "%3dd %2dh %2dm %2ds".
int formatDuration(int64_t seconds, char* buf, size_t size);
// "%2dh %2dm %2d.%03ds" of milliseconds.
int formatMillis(uint64_t millis, char* buf, size_t size);
int formatMillis32(uint32_t millis, char* buf, size_t size);

// ---------------------------------------------------------------------------
// Strings and names
// ---------------------------------------------------------------------------
// Copies src with its NUL when it fits `size`; otherwise message 569 and
// 6005 with dst untouched.
int copyStringIntoBuffer(char* dst, const char* src, size_t size);
// Checks (and unquoted: upper-cases in place) an SQL identifier; *length gets
// its length with a doubled quote counted once. Answers 0 or 2002.
int checkIdentifier(char* name, int32_t* length);
// One word of a word sequence.
struct klpWord {
  int16_t length;
  const char* text;
};
// Answers 1 when the words occur in order in text (case-blind, separated by
// blanks, tabs, line feeds or carriage returns), else 0.
int searchWordSequence(int32_t length, const char* text, int count, const klpWord* words);
// The pad character of a code page into out (2 bytes at most). Answers the
// bytes written, or 430 for an unknown code page.
int getPadChar(int32_t ccsid, char* out);
constexpr int KLP_RC_UNKNOWN_CCSID = 430;
// 0 when the program is "xqpub" and its string parameter 33 is "0905",
// "0901" or "0802"; otherwise 1. Worked out once per process.
int getCompatibilityLevel();

// ---------------------------------------------------------------------------
// The program's own files
// ---------------------------------------------------------------------------
enum : uint32_t {
  KLP_FILE_WRITE = 1,    // "w"
  KLP_FILE_APPEND = 2,   // "a"
  KLP_FILE_BINARY = 4,   // "b" instead of "t"
  KLP_FILE_TEMP = 24,    // in the temporary directory, named by program and process
};
// Opens "<tmpdir><program>.<pid>.<suffix>" (KLP_FILE_TEMP) or
// "<path parameter><name prefix>.<suffix>". nameOut/errOut are optional.
// Answers 0, or errno after message 626 (outs empty). A name that does not
// fit nameOut (or 1040 characters) answers ENAMETOOLONG.
int getFileHandle(FILE** fh, uint32_t flags, const char* suffix, char* nameOut, size_t nameSize,
                  char* errOut, size_t errSize);

// ---------------------------------------------------------------------------
// Wildcard criteria
// ---------------------------------------------------------------------------
enum : int32_t {
  KLP_WILD_NONE = 0,    // exact
  KLP_WILD_PREFIX = 1,  // one "%" at the end
  KLP_WILD_FULL = 2,    // "%" elsewhere
  KLP_WILD_ALL = 4,     // just "%"
};
constexpr int KLP_WILD_MAX_PERCENT = 128;
// Prepares a pattern in place and answers its kind.
int32_t prepareIgnTransCriteria(char* pattern);
// 1 when the whole text matches the pattern ("%" any run, "\" literal), else 0.
int compareIgnTransCriteria(const char* pattern, const char* text);
