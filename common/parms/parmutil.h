// Text helpers of the parameter framework: keywords, decimal numbers and the
// schema-name rule.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>

// Upper case of one character (ASCII letters only, as keywords are).
inline char parmUpper(char c) { return (c >= 'a' && c <= 'z') ? static_cast<char>(c - 32) : c; }

// The keyword of an argument (the text before the first "=", or all of it),
// upper-cased into out[33]. False, with out empty, when it is longer than 32.
bool upperKeyword(const char* arg, char* out, size_t* len);

// Copies the start of text, upper-cased, into out[outSize] (always
// terminated, cut when longer).
void upperCopy(const char* text, char* out, size_t outSize);

// A whole base-10 number (leading blanks and a sign allowed, nothing after
// the digits) that fits 32 bits.
enum { PARM_NUM_OK = 0, PARM_NUM_GARBAGE = 1, PARM_NUM_OVERFLOW = 2 };
int parseDecimal(const char* text, int32_t* value);

// The schema rule, under the user's default locale: a value in double quotes
// loses them and keeps its case, any other value is turned to upper case;
// either way only letters, digits and "_" may remain. False when the value
// breaks the rule (out is then unchanged).
bool applySchemaRule(const char* value, std::string* out);
