// Fuzz target: a reply payload as a server could send it, taken as status
// data of each format, as a status size answer and as a STATUS reply the
// command program prints (its messages captured). The first two bytes are
// the capacity of the caller's buffer, which is allocated to exactly that
// size so that any write beyond it is caught.
#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <vector>

#include "common/ipc/cmdapi.h"
#include "common/ipc/ipcmsg.h"
#include "common/msg/klplog.h"
#include "common/msg/msglogger.h"
#include "common/util/klprc.h"

namespace {

using Converter = int (*)(const char*, size_t, char*, size_t, int32_t*);

void convert(Converter conv, const char* payload, size_t len, size_t outLen) {
  // Left uninitialised: clearing buffers of up to a megabyte on every input
  // would cost more than the conversion.
  std::unique_ptr<char[]> out(outLen ? new char[outLen] : nullptr);
  int32_t required = -1;
  int rc = conv(payload, len, out.get(), outLen, &required);
  if (rc != 0 && rc != KLP_API_BUFFER_TOO_SMALL && rc != KLP_API_BAD_REPLY) abort();
  if (rc != KLP_API_BAD_REPLY && required <= 0) abort();
}

// Messages are composed but go nowhere.
bool quietLogger() {
  msgLogger* logger = createMsgLoggerU(5, 0);
  for (char sev : {'I', 'W', 'E', 'D'}) logger->setRoutingWord(sev, 0);
  logger->loadBuiltinMsgs(builtinMsgTable);
  klpSetProcessLogger(logger);
  return true;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static bool ready = quietLogger();
  (void)ready;
  if (size < 2) return 0;
  size_t outLen = static_cast<size_t>(data[0]) | (static_cast<size_t>(data[1]) << 8);
  const char* payload = reinterpret_cast<const char*>(data + 2);
  size_t len = size - 2;
  convert(klpStatusFromThreads, payload, len, outLen);
  convert(klpStatusFromKcap, payload, len, outLen * 4);
  convert(klpStatusFromKapp, payload, len, outLen * 16);

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

  // The payload as a STATUS reply the command program prints, cut to 16
  // thread records: every record prints the same message, and a long reply
  // would spend the run composing them. An exact-size copy, so that a read
  // past it is caught.
  size_t shown = std::min(len, IPC_STATUS_HEADER + 16 * IPC_STATUS_RECORD);
  std::vector<char> exact(payload, payload + shown);
  klpMsgCapture capture{};
  printState(exact.empty() ? nullptr : exact.data(), shown, &capture);
  if (capture.length > KLP_CAPTURE_CHARS || capture.text[capture.length] != '\0') abort();
  return 0;
}
