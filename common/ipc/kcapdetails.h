// Layout of the payload a K Capture server answers STATUS SHOW DETAILS with:
// byte offsets from the start of the reply payload, little-endian. The
// server writes it, the status collector reads it into status format 3.
#pragma once

#include <cstddef>

namespace kcapDetails {
constexpr size_t kUpTime = 12;       // int32: seconds since the server started
constexpr size_t kLogFileRef = 16;   // uint16: offset of the log file name (length-prefixed)
constexpr size_t kActiveSubs = 20;   // int32: active subscriptions
constexpr size_t kLogTime = 24;      // current log time, "%Y-%m-%d-%H.%M.%S.uuuuuu"
constexpr size_t kLogTimeLen = 26;
constexpr size_t kLsn = 51;          // 8 bytes: all-published log sequence number
constexpr size_t kLsnLen = 8;
constexpr size_t kMemory = 64;       // int32: memory in use, bytes
constexpr size_t kSectionRef = 68;   // uint16: offset of the two 30-byte sections and a text; 0: none
constexpr size_t kMinSize = 70;      // the fixed part
}  // namespace kcapDetails
