// Fuzz target: bytes as they could arrive on a command-channel queue.
// The input is first taken as one received message, then as a sequence of
// messages (each preceded by a 16-bit length) fed to the reply gatherer, so
// that damaged piece headers are exercised along with damaged messages.
#include <cstdint>
#include <cstdlib>
#include <cstring>

#include "common/ipc/ipcmsg.h"

namespace {

void useMessage(const uint8_t* data, size_t size, IpcGather* gather) {
  IpcMsgView view;
  if (ipcDecodeMsg(data, size, &view) != 0) return;
  // Everything the view claims must lie inside what was received.
  if (view.payloadLen + IPC_HEADER_SIZE != size) abort();
  if (view.payloadLen && view.payload != reinterpret_cast<const char*>(data) + IPC_HEADER_SIZE)
    abort();
  char text[64];
  size_t n = ipcPayloadText(view, text, sizeof text);
  if (n >= sizeof text || text[n] != '\0') abort();
  MsgQe* qe = nullptr;
  if (createMsgQe(&qe, view) == 0) {
    if (strnlen(qe->QeString, MSGQE_STRING_SIZE) >= MSGQE_STRING_SIZE) abort();
    deleteMsgQe(qe);
  }
  if (gather) {
    int32_t left = 0;
    size_t before = gather->gathered();
    if (gather->add(view, &left) == 0 && gather->gathered() != before + view.payloadLen) abort();
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  useMessage(data, size, nullptr);

  IpcGather gather;
  size_t pos = 0;
  while (pos + 2 <= size) {
    size_t len = static_cast<size_t>(data[pos]) | (static_cast<size_t>(data[pos + 1]) << 8);
    pos += 2;
    if (len > size - pos) len = size - pos;
    useMessage(data + pos, len, &gather);
    pos += len;
  }
  size_t gathered = gather.gathered();
  char* reply = gather.release();
  if (reply) {
    int32_t count;
    memcpy(&count, reply + 4, 4);
    if (count < 0 || static_cast<size_t>(count) != gathered) abort();
    free(reply);
  }
  return 0;
}
