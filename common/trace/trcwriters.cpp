// The writers' marks (see trc_internal.h): one slot per thread, claimed at
// its first trace point and given back when the thread ends, and the wait
// of the one that withdraws the block.
#include <linux/membarrier.h>
#include <pthread.h>
#include <sys/syscall.h>
#include <unistd.h>

#include "common/trace/trc_internal.h"

namespace trcint {

__attribute__((tls_model("initial-exec"))) thread_local WriterSlot* t_slot = nullptr;
bool g_asymmetric = false;
std::atomic<int32_t> g_slotless{0};

namespace {

constexpr int kSlots = 256;
WriterSlot g_slots[kSlots];
std::atomic<size_t> g_mappedSize{0};
pthread_key_t g_slotKey;
pthread_once_t g_keyOnce = PTHREAD_ONCE_INIT;

// The kernel thread id costs a system call, so each thread asks once; a fork
// makes every cached id stale (the child's thread has another one).
std::atomic<uint32_t> g_forkGeneration{1};
__attribute__((tls_model("initial-exec"))) thread_local uint32_t t_threadId = 0;
__attribute__((tls_model("initial-exec"))) thread_local uint32_t t_generation = 0;

bool registerBarrier() {
  return syscall(__NR_membarrier, MEMBARRIER_CMD_REGISTER_PRIVATE_EXPEDITED, 0, 0) == 0;
}

// A thread that ends, also by cancellation inside a trace point, gives its
// slot back so that a later withdrawal does not wait for it.
void releaseSlot(void* p) {
  auto* s = static_cast<WriterSlot*>(p);
  s->inside.store(0, std::memory_order_release);
  s->owned.store(0, std::memory_order_release);
}

// The child of a fork has only the forking thread: the other slots are
// free there, whatever their threads were doing in the parent.
void afterForkInChild() {
  for (WriterSlot& s : g_slots) {
    if (&s == t_slot) continue;
    s.inside.store(0, std::memory_order_relaxed);
    s.owned.store(0, std::memory_order_relaxed);
  }
  g_slotless.store(0, std::memory_order_relaxed);
  // The barrier's registration belongs to the parent's address space.
  if (g_asymmetric) g_asymmetric = registerBarrier();
  g_forkGeneration.fetch_add(1, std::memory_order_relaxed);
  g_trcAnchorStorage.pid = hsvProcessID();
}

void makeKey() {
  pthread_key_create(&g_slotKey, releaseSlot);
  pthread_atfork(nullptr, nullptr, afterForkInChild);
}

}  // namespace

WriterSlot* claimSlot() {
  pthread_once(&g_keyOnce, makeKey);
  for (WriterSlot& s : g_slots) {
    uint32_t free = 0;
    if (s.owned.compare_exchange_strong(free, 1, std::memory_order_acq_rel)) {
      pthread_setspecific(g_slotKey, &s);
      t_slot = &s;
      return &s;
    }
  }
  return nullptr;
}

void prepareWriters() {
  pthread_once(&g_keyOnce, makeKey);
  if (!g_asymmetric) g_asymmetric = registerBarrier();
}

void publishBlock(trcBlockHeader* block, size_t size) {
  if (block != nullptr) {
    g_mappedSize.store(size, std::memory_order_relaxed);
    __atomic_store_n(&g_trcAnchorStorage.block, block, __ATOMIC_SEQ_CST);
    return;
  }
  __atomic_store_n(&g_trcAnchorStorage.block, static_cast<trcBlockHeader*>(nullptr),
                   __ATOMIC_SEQ_CST);
  // Every thread passes a full barrier: a writer that marked itself inside
  // is seen now, one that had not yet looked at the block sees it gone.
  if (g_asymmetric && syscall(__NR_membarrier, MEMBARRIER_CMD_PRIVATE_EXPEDITED, 0, 0) != 0) {
    // Refused after all: from now on writers fence themselves; those that
    // did not are through their few instructions well within this wait.
    g_asymmetric = false;
    hsvSleep(10);
  }
  for (WriterSlot& s : g_slots)
    while (s.inside.load(std::memory_order_acquire) != 0 && &s != t_slot) hsvSleep(1);
  while (g_slotless.load(std::memory_order_acquire) != 0) hsvSleep(1);
  g_mappedSize.store(0, std::memory_order_relaxed);
}

size_t mappedSize() { return g_mappedSize.load(std::memory_order_relaxed); }

uint32_t threadId() {
  uint32_t gen = g_forkGeneration.load(std::memory_order_relaxed);
  if (t_generation != gen) {
    pthread_once(&g_keyOnce, makeKey);  // so that a later fork marks this id stale
    gen = g_forkGeneration.load(std::memory_order_relaxed);
    t_threadId = static_cast<uint32_t>(hsvThreadID());
    t_generation = gen;
  }
  return t_threadId;
}

}  // namespace trcint
