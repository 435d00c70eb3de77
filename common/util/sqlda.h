// The SQL descriptor snapshot: builds, prints and frees an SQL descriptor
// area (SQLDA) in the published layout of the database client interface, for
// the preparation of dynamic SQL statements.
#pragma once

#include <cstddef>
#include <cstdint>

struct sqlname {
  int16_t length;
  char data[30];
};

struct sqlvar {
  int16_t sqltype;
  int16_t sqllen;
  void* sqldata;
  int16_t* sqlind;
  struct sqlname sqlname;
};

struct sqlda {
  char sqldaid[8];  // "SQLDA   "
  int32_t sqldabc;  // 16 + 56 * sqln
  int16_t sqln;
  int16_t sqld;
  struct sqlvar sqlvar[1];  // sqln entries
};

static_assert(sizeof(sqlvar) == 56, "SQLDA entry layout");
static_assert(offsetof(sqlda, sqlvar) == 16, "SQLDA header layout");

constexpr int SQLDA_MAX_ENTRIES = 32767;  // sqln is 16 bits

// A zeroed area with n empty entries into *out. 0; 801 after
// "snapDA: malloc failed"; 2002 for n outside 0..32767 (*out empty then).
int snapDAAlloc(sqlda** out, int n);
// The same, each entry i typed by types[i]: sqltype its high 16 bits, sqllen
// its low 16 bits. The first form answers n, the second *out; on a failure
// *out is empty and the first answers -1.
int snapDAAllocTyped(sqlda** out, int n, const uint32_t* types);
sqlda* snapDAAllocTypedPtr(sqlda** out, int n, const uint32_t* types);
// Prints the header line and one line per entry on standard output.
void snapDAPrint(sqlda** da);
// Frees the area and empties the pointer.
void snapDAFree(sqlda** da);
