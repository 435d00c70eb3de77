// Trace points. Every traced function marks its entry, exit and data with
// these; they cost one load and compare while the process's trace anchor is
// not Running, and then answer 0.
#pragma once

#include <cstdint>
#include <type_traits>

// Trace anchor states.
enum : uint32_t {
  TRC_STATE_INITIAL = 0x11111111,
  TRC_STATE_STARTING = 0x0F1E2D3C,
  TRC_STATE_RUNNING = 0x4B5A6978,
  TRC_STATE_STOP = 0x33333333,
  TRC_STATE_STOPPING = 0x77777777,
  TRC_STATE_STOPPED = 0xFFFFFFFF,
};

// Return kinds of trcExit.
enum : int { TRC_RET_NONE = 0, TRC_RET_RC = 1, TRC_RET_BOOL = 2, TRC_RET_PTR = 3 };

// The state word of the process's trace anchor.
uint32_t trcAnchorState();
inline bool trcIsRunning() { return trcAnchorState() == TRC_STATE_RUNNING; }

// Effective level mask of (component, function); 0 while tracing is off.
uint32_t trcLevel(int component, int function);
uint32_t trcEntry(int component, int function);
void trcExit(int component, int function, int returnKind, int16_t value16 = 0,
             int32_t value32 = 0, int64_t value64 = 0);

// Common body of the trcData family: up to 32 objects (more are ignored).
uint32_t trcDataN(int component, int function, const char* dataName, uint32_t levelMask,
                  int objectCount, const int* types, const uint32_t* lengths,
                  const void* const* pointers);

// trcData with 1 to 9 objects, each given as (type, length, pointer).
template <typename... Rest>
inline uint32_t trcData(int component, int function, const char* dataName, uint32_t levelMask,
                        int type, uint32_t length, const void* pointer, Rest... rest) {
  static_assert(sizeof...(Rest) % 3 == 0 && sizeof...(Rest) / 3 <= 8,
                "trcData takes 1 to 9 (type, length, pointer) objects");
  if (!trcIsRunning()) return 0;
  constexpr int n = 1 + static_cast<int>(sizeof...(Rest)) / 3;
  int types[n];
  uint32_t lengths[n];
  const void* pointers[n];
  types[0] = type;
  lengths[0] = length;
  pointers[0] = pointer;
  if constexpr (sizeof...(Rest) > 0) {
    int i = 1, k = 0;
    auto take = [&](auto v) {
      if constexpr (std::is_pointer_v<decltype(v)> || std::is_null_pointer_v<decltype(v)>) {
        pointers[i++] = static_cast<const void*>(v);
        k = 0;
      } else if (k == 0) {
        types[i] = static_cast<int>(v);
        k = 1;
      } else {
        lengths[i] = static_cast<uint32_t>(v);
      }
    };
    (take(rest), ...);
  }
  return trcDataN(component, function, dataName, levelMask, n, types, lengths, pointers);
}
