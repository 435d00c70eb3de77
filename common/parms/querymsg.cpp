// The parameter query message a server sends for QRYPARMS, and the printout
// of a registry's displayed parameters.
//
// Message: count (2), "KLPQRYMG" (8), then per parameter a record: length
// (2) = 40 + value length, source (2), name length (2), name (32), value
// length (2), value. Integers little-endian, no padding.
#include <cstdio>
#include <cstring>
#include <string>

#include "common/msg/klplog.h"
#include "common/parms/klpparm.h"
#include "common/util/klprc.h"

namespace {

constexpr size_t kHeaderSize = KLP_QUERY_HEADER_SIZE;
constexpr size_t kRecordFixed = KLP_QUERY_RECORD_FIXED;

bool included(const ParmEntry& s) {
  return s.display == 1 || (s.display == -1 && s.source != PARM_SRC_DEFAULT);
}

// The value text of a slot, at most 1040 characters.
std::string valueText(const ParmEntry& s) {
  std::string v;
  switch (s.type) {
    case PARM_INTEGER: v = std::to_string(s.intValue); break;
    case PARM_STRING: v = s.strValue ? s.strValue : ""; break;
    case PARM_BOOLEAN: v = s.boolValue == 1 ? "Y" : "N"; break;
    default: break;
  }
  if (v.size() > KLP_PARM_VALUE_MAX) v.resize(KLP_PARM_VALUE_MAX);
  return v;
}

void put16(uint8_t* p, size_t v) {
  p[0] = static_cast<uint8_t>(v & 0xFF);
  p[1] = static_cast<uint8_t>((v >> 8) & 0xFF);
}

unsigned get16(const uint8_t* p) { return p[0] | (static_cast<unsigned>(p[1]) << 8); }

}  // namespace

size_t klpParmClass::getQueryMsgSize() const {
  size_t size = kHeaderSize;
  for (const auto& s : slots_)
    if (included(s)) size += kRecordFixed + valueText(s).size();
  return size;
}

int klpParmClass::setQueryMsg(void* buffer) const {
  if (!buffer) return KLP_RC_BAD_PARM;
  uint8_t* msg = static_cast<uint8_t*>(buffer);
  memcpy(msg + 2, "KLPQRYMG", 8);
  size_t pos = kHeaderSize;
  unsigned count = 0;
  for (const auto& s : slots_) {
    if (!included(s)) continue;
    std::string v = valueText(s);
    size_t nameLen = strnlen(s.name, KLP_PARM_NAME_MAX);
    uint8_t* r = msg + pos;
    put16(r, kRecordFixed + v.size());
    put16(r + 2, static_cast<size_t>(s.source) & 0xFFFF);
    put16(r + 4, nameLen);
    memset(r + 6, 0, KLP_PARM_NAME_MAX);
    memcpy(r + 6, s.name, nameLen);
    put16(r + 38, v.size());
    memcpy(r + kRecordFixed, v.data(), v.size());
    pos += kRecordFixed + v.size();
    ++count;
  }
  put16(msg, count);
  return KLP_OK;
}

int klpParmClass::getQueryMsg(const void* message, size_t msgLen) const {
  if (!message || msgLen < kHeaderSize) return KLP_RC_BAD_PARM;
  const uint8_t* msg = static_cast<const uint8_t*>(message);
  unsigned count = get16(msg);
  size_t pos = kHeaderSize;
  // The message comes from another process: every length is checked against
  // the bytes received before anything is read.
  for (unsigned i = 0; i < count; ++i) {
    if (msgLen - pos < kRecordFixed) return KLP_RC_BAD_PARM;
    const uint8_t* r = msg + pos;
    size_t recLen = get16(r);
    unsigned source = get16(r + 2);
    size_t nameLen = get16(r + 4);
    size_t valueLen = get16(r + 38);
    if (recLen < kRecordFixed || recLen > msgLen - pos || nameLen > KLP_PARM_NAME_MAX ||
        valueLen > KLP_PARM_VALUE_MAX || valueLen > msgLen - pos - kRecordFixed)
      return KLP_RC_BAD_PARM;
    char name[KLP_PARM_NAME_MAX + 1];
    char value[KLP_PARM_VALUE_MAX + 1];
    memcpy(name, r + 6, nameLen);
    name[nameLen] = '\0';
    memcpy(value, r + kRecordFixed, valueLen);
    value[valueLen] = '\0';
    logKlpMsg(521, "klpParmClass:getQueryMsg", KLP_DEST_CONSOLE, name, nullptr, 2, value,
              parmSourceLabel(static_cast<int32_t>(source), tableName_));
    pos += recLen;
  }
  return KLP_OK;
}

void klpParmClass::printParms() const {
  for (const auto& s : slots_) {
    if (!included(s)) continue;
    std::string v = valueText(s);
    logKlpMsg(529, "klpParmClass::printParms", KLP_DEST_SEVERITY, s.name, nullptr, 2, v.c_str(),
              parmSourceLabel(s.source, tableName_));
  }
}
