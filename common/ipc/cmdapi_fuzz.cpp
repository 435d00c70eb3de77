// Fuzz target: a reply payload as a server could send it, taken as status
// data of each format, as a STATUS reply to print and as a status size
// answer. The first two bytes are
// the capacity of the caller's buffer, which is allocated to exactly that
// size so that any write beyond it is caught.
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <vector>

#include "common/ipc/cmdapi.h"
#include "common/util/klprc.h"

namespace {

using Converter = int (*)(const char*, size_t, char*, size_t, int32_t*);

void convert(Converter conv, const char* payload, size_t len, size_t outLen) {
  std::vector<char> out(outLen);
  int32_t required = -1;
  int rc = conv(payload, len, out.empty() ? nullptr : out.data(), outLen, &required);
  if (rc != 0 && rc != KLP_API_BUFFER_TOO_SMALL && rc != KLP_API_BAD_REPLY) abort();
  if (rc != KLP_API_BAD_REPLY && required <= 0) abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 2) return 0;
  size_t outLen = static_cast<size_t>(data[0]) | (static_cast<size_t>(data[1]) << 8);
  const char* payload = reinterpret_cast<const char*>(data + 2);
  size_t len = size - 2;
  convert(klpStatusFromThreads, payload, len, outLen);
  convert(klpStatusFromKcap, payload, len, outLen * 4);
  convert(klpStatusFromKapp, payload, len, outLen * 16);
  klpMsgCapture cap{};
  int prc = printState(payload, len, &cap);
  if ((prc != 0 && (prc != 817 || cap.length != 0)) || cap.length > KLP_CAPTURE_CHARS ||
      cap.text[cap.length] != '\0')
    abort();

  // The same bytes as a reply buffer: senderPid, payload length, payload.
  std::vector<char> reply(KLP_REPLY_HEADER + len);
  int32_t l = static_cast<int32_t>(len);
  std::memcpy(reply.data() + 4, &l, sizeof(l));
  if (len) std::memcpy(reply.data() + KLP_REPLY_HEADER, payload, len);
  for (int32_t kind : {KLP_KIND_MON, KLP_KIND_KAPP}) {
    int32_t statusSize = -1;
    int rc = klpStatusSizeFromReply(kind, reply.data(), &statusSize, nullptr);
    if (rc == 0 ? statusSize < 32 : (rc != KLP_API_BAD_REPLY || statusSize != 0)) abort();
  }
  return 0;
}
