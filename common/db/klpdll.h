// Run-time loading of a client library: a descriptor names candidate files
// (tried in order, each with the suffix its function names carry) and a table
// of functions to resolve from the one that loads. Nothing is linked against
// the client libraries; a program loads them on first use.
#pragma once

#include <bitset>
#include <cstdint>
#include <mutex>

#include "common/platform/hsv.h"

constexpr int KLPDLL_RC_NOT_LOADED = 821;

// Descriptor state: while not loaded, these flags; once loaded, the index of
// the candidate that loaded.
enum : uint16_t {
  KLPDLL_NOT_LOADED = 0x4000,
  KLPDLL_FAILURE_REPORTED = 0x2000,
  KLPDLL_FAILURE_SEEN_AGAIN = 0x1000,
};

struct klpDLLCandidate {
  const char* fileName;
  const char* suffix;  // appended to every function name when resolving
};

// A slot holding KLPDLL_OPTIONAL before loading marks a function that may be
// missing without a message; after loading it holds the address or null.
struct klpDLLFunc {
  const char* name;
  void* slot;
};
inline void* const KLPDLL_OPTIONAL = reinterpret_cast<void*>(1);

class klpDLL;
namespace klpdll {
int loadLib(klpDLL* dll);
}

class klpDLL {
 public:
  klpDLL(const char* name, const klpDLLCandidate* candidates, uint16_t candidateCount,
         klpDLLFunc* functions, uint16_t functionCount);
  ~klpDLL();  // unloads a loaded library
  klpDLL(const klpDLL&) = delete;
  klpDLL& operator=(const klpDLL&) = delete;

  const char* name;
  uint16_t state = KLPDLL_NOT_LOADED;
  uint16_t candidateCount;
  const klpDLLCandidate* candidates;
  uint16_t functionCount;
  klpDLLFunc* functions;
  HSVSharedLib library;

 private:
  friend int klpdll::loadLib(klpDLL* dll);
  std::mutex lock_;        // two threads may ask for the library at once
  uint16_t tried_ = 0;     // candidates tried so far
  std::bitset<256> optional_;  // functions marked optional (the first 256)
};

namespace klpdll {
// Loads the first candidate that loads (message 606) and resolves the
// functions (message 617 for each required one that is missing). 0, or 821
// with message 616 the first time every candidate failed; later calls after
// such a failure answer 0 silently with KLPDLL_NOT_LOADED still set, so
// callers test the state.
int loadLib(klpDLL* dll);
// Message 615: origin, text and the candidate file names.
void reportLibs(const klpDLL* dll, const char* origin, const char* text);
}  // namespace klpdll

// The program's two ODBC driver descriptors ("ODB_DLL"); in the second, some
// functions are optional.
klpDLL& klpOdbcDLL();
klpDLL& klpOdbcAltDLL();
