// Shared by the trace module's own sources: who may use the attached block.
// A trace point may run on any thread while another thread lets go of the
// block, so a writer marks itself inside before it looks at the block, and
// the one letting go unmaps only once no writer is inside any more. Each
// thread marks a flag of its own, so writers never share a cache line; the
// one letting go pays for the ordering (a process-wide barrier) instead.
#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>

#include "common/trace/trcblock.h"

namespace trcint {

struct alignas(64) WriterSlot {
  std::atomic<uint32_t> inside;  // 1 while the owner thread may use the block
  std::atomic<uint32_t> owned;   // 1 while a thread holds this slot
};

extern __attribute__((tls_model("initial-exec"))) thread_local WriterSlot* t_slot;
// True when the process-wide barrier is available; otherwise each writer
// orders itself with a full fence.
extern bool g_asymmetric;
extern std::atomic<int32_t> g_slotless;  // writers of threads that found no free slot

WriterSlot* claimSlot();  // null when every slot is taken

// The attached block with the caller marked inside, or null (not marked)
// when none is attached or the anchor is not Running.
inline trcBlockHeader* enterBlock() {
  WriterSlot* s = t_slot != nullptr ? t_slot : claimSlot();
  if (s != nullptr) {
    s->inside.store(1, std::memory_order_relaxed);
    if (g_asymmetric)
      std::atomic_signal_fence(std::memory_order_seq_cst);
    else
      std::atomic_thread_fence(std::memory_order_seq_cst);
  } else {
    g_slotless.fetch_add(1, std::memory_order_seq_cst);
  }
  trcBlockHeader* b = __atomic_load_n(&g_trcAnchorStorage.block, __ATOMIC_ACQUIRE);
  if (b != nullptr && trcIsRunning()) return b;
  if (s != nullptr)
    s->inside.store(0, std::memory_order_release);
  else
    g_slotless.fetch_sub(1, std::memory_order_release);
  return nullptr;
}

// Leaves a block entered with enterBlock.
inline void leaveBlock() {
  if (t_slot != nullptr)
    t_slot->inside.store(0, std::memory_order_release);
  else
    g_slotless.fetch_sub(1, std::memory_order_release);
}

// Publishes (or, with null, withdraws) the anchor's block and its mapped
// size; withdrawing waits until no writer is inside any more.
void publishBlock(trcBlockHeader* block, size_t mappedSize);
// Bytes mapped of the published block; valid while the caller is inside.
size_t mappedSize();
// The calling thread's id as records carry it.
uint32_t threadId();
// Registers the process for the process-wide barrier (once).
void prepareWriters();

}  // namespace trcint
