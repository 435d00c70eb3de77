// Fuzz target: one trace object as a buffer or a file could hold it. The
// first two bytes are the object type, the rest its data; it is formatted as
// fmt prints it, in hexadecimal, and as the return value of an exit record.
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "common/trace/trcobjfmt.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static FILE* sink = fopen("/dev/null", "w");
  if (size < 2 || sink == nullptr) return 0;
  uint16_t type;
  memcpy(&type, data, sizeof type);
  // A copy of exactly the object's bytes, so that any read beyond them is
  // caught.
  size_t length = size - 2 > 0xFFFF ? 0xFFFF : size - 2;
  uint8_t* copy = static_cast<uint8_t*>(malloc(length ? length : 1));
  memcpy(copy, data + 2, length);
  trcFormatObject(sink, type, static_cast<uint32_t>(length), copy, false);
  trcFormatObject(sink, type, static_cast<uint32_t>(length), copy, true);
  trcObject obj{type, static_cast<uint16_t>(length), copy, 1};
  trcPutReturnValue(sink, obj);
  free(copy);
  return 0;
}
