// klptrcbp: the trace buffer keeper. The trace command starts it as
//
//   klptrcbp <IPC directory> <name prefix>
//
// once it has created a trace block. That first process starts the keeper
// proper (`klptrcbp -hold ...`, in a session of its own) and ends at once,
// so that the command never leaves a child behind. The keeper attaches to the
// block and holds it while no server may be attached, and lets go as soon as
// the trace is turned off or killed (the block's status is no longer
// Starting or Running) or the block is gone. It never destroys the block:
// that is left to the trace command and the server. See
// docs/trace-keeper.md.
#include <cstddef>
#include <cstring>

#include "common/platform/hsv.h"
#include "common/trace/trace_anchor.h"

namespace {

constexpr uint32_t kPollMs = 200;
constexpr int kPresenceEvery = 10;  // polls between checks that the block is still named

bool stillNamed(const char* keyPart1, const char* keyPart2) {
  HSVHIPCMemory* memory = nullptr;
  trcBlockHeader* block = nullptr;
  if (trcOpenBlock(keyPart1, keyPart2, &memory, &block) != ECF_OK) return false;
  memory->detach();
  delete memory;
  return true;
}

int hold(const char* keyPart1, const char* keyPart2) {
  HSVHIPCMemory* memory = nullptr;
  trcBlockHeader* block = nullptr;
  if (trcOpenBlock(keyPart1, keyPart2, &memory, &block) != ECF_OK) return 0;
  // The header is packed, but the block is page-aligned and the status word
  // sits at a multiple of 4: read it as the aligned word it is, which every
  // compiler loads inline.
  const uint32_t* statusWord = reinterpret_cast<const uint32_t*>(
      reinterpret_cast<const char*>(block) + offsetof(trcBlockHeader, status));
  for (int polls = 1;; ++polls) {
    uint32_t status = __atomic_load_n(statusWord, __ATOMIC_ACQUIRE);
    if (status != TRC_STATE_RUNNING && status != TRC_STATE_STARTING) break;
    if (polls % kPresenceEvery == 0 && !stillNamed(keyPart1, keyPart2)) break;
    hsvSleep(kPollMs);
  }
  memory->detach();
  delete memory;
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc == 4 && strcmp(argv[1], "-hold") == 0) return hold(argv[2], argv[3]);
  if (argc != 3) return 2;
  const char* args[] = {"klptrcbp", "-hold", argv[1], argv[2], nullptr};
  int32_t pid = 0;
  return hsvStartProcess("klptrcbp", args, &pid) == ECF_OK ? 0 : 1;
}
