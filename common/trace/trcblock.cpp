// Helpers over the trace block layouts shared by the writer, the readers and
// the formatters.
#include "common/trace/trcblock.h"

#include <cstring>

uint16_t trcFilterLevel(const trcBlockHeader* h, int component, int function) {
  if (component < 0 || component >= TRC_COMPONENTS || function < 0 || function >= TRC_FUNCTIONS)
    return 0;
  uint16_t word = h->functionFilters[component][function];
  if (word & TRC_FILTER_OVERRIDE) return word & TRC_FILTER_LEVELS;
  word = h->componentFilters[component];
  if (word & TRC_FILTER_OVERRIDE) return word & TRC_FILTER_LEVELS;
  return h->globalFilter;
}

uint32_t trcRecordSize(int objectCount, const uint32_t* lengths) {
  uint32_t size = TRC_RECORD_HEADER_SIZE;
  for (int i = 0; i < objectCount; ++i) size += TRC_OBJECT_HEADER_SIZE + ((lengths[i] + 3) & ~3u);
  return size;
}

const char* trcStatusText(uint32_t word) {
  switch (word) {
    case TRC_STATE_INITIAL: return "Initial";
    case TRC_STATE_STARTING: return "Starting";
    case TRC_STATE_RUNNING: return "Running";
    case TRC_STATE_STOP: return "Stop";
    case TRC_STATE_STOPPING: return "Stopping";
    case TRC_STATE_STOPPED: return "Stopped";
    default: return "INVALID STATUS";
  }
}

const char* trcObjectTypeName(unsigned type) {
  static const char* const kNames[TRC_OBJ_TYPE_COUNT] = {
      "Raw binary data",
      "Signed Integer",
      "Null-terminated string (PLEASE CHANGE TO \"TRCString\"",
      "String",
      "SqlCa",
      "SqlDa",
      "SqlStatement",
      "Name of an object or structure",
      "Ordered List class instance",
      "Ordered List Element",
      "Ordered List Element Address",
      "External Message Queue Element",
      "klpThread class instance",
      "return code",
      "trans class instance",
      "NULL Pointer",
      "Unsigned Integer",
      "Boolean",
      "Pointer",
      "Timestamp",
      "GTran class instance",
      "SqlStatement type",
      "KCapture admin message type",
  };
  return type < TRC_OBJ_TYPE_COUNT ? kNames[type] : "UNKNOWN";
}

void trcThreadIdText(uint32_t threadId, char (&out)[64]) {
  static const char kHex[] = "0123456789abcdef";
  unsigned char bytes[4];
  memcpy(bytes, &threadId, sizeof bytes);
  memset(out, 0, sizeof out);
  memcpy(out, "tid = 0x", 8);
  for (int i = 0; i < 4; ++i) {
    out[8 + 2 * i] = kHex[bytes[i] >> 4];
    out[9 + 2 * i] = kHex[bytes[i] & 15];
  }
}
