// Thread data tables: names (and a little data) of a process's threads by
// thread id, kept in the process and copied into the trace block so that a
// formatter in another process can name the threads of a record. Table A is
// hashed (slot = id mod 150); table B takes the ids whose slot is taken, in
// order.
#include <algorithm>
#include <cstring>
#include <mutex>

#include "common/trace/trace_anchor.h"
#include "common/trace/trc_internal.h"

namespace {

trcThreadData g_tableA[TRC_THREAD_SLOTS];
trcThreadData g_tableB[TRC_THREAD_SLOTS];
int g_countB = 0;
bool g_initialised = false;  // entries set free
bool g_inUse = false;        // an entry was stored by this process

// Created on first use; the owner may take it again.
std::recursive_mutex& tableLock() {
  static std::recursive_mutex* lock = new std::recursive_mutex;
  return *lock;
}

void setFree(trcThreadData* entries) {
  memset(entries, 0, sizeof(trcThreadData) * TRC_THREAD_SLOTS);
  for (int i = 0; i < TRC_THREAD_SLOTS; ++i) entries[i].key = TRC_FREE_KEY;
}

void initialise() {
  if (g_initialised) return;
  setFree(g_tableA);
  setFree(g_tableB);
  g_countB = 0;
  g_initialised = true;
}

void fill(trcThreadData* dst, const trcThreadData* src) {
  dst->threadId = src->threadId;
  trcThreadIdText(src->threadId, dst->threadIdText);
  memcpy(dst->threadName, src->threadName, sizeof dst->threadName);
  memcpy(dst->data, src->data, sizeof dst->data);
  dst->key = src->threadId;
}

// Stand-ins for a thread id found in neither table: 1 when its slot is free,
// 2 when the slot holds another id.
const trcThreadData* substitute(int which) {
  static trcThreadData unknown[2];
  static std::once_flag once;
  std::call_once(once, [] {
    for (int i = 0; i < 2; ++i) {
      unknown[i].threadId = TRC_FREE_KEY;
      unknown[i].key = TRC_FREE_KEY;
      trcThreadIdText(TRC_FREE_KEY, unknown[i].threadIdText);
    }
    strcpy(unknown[0].threadName, "UNKNOWN THREAD1");
    strcpy(unknown[1].threadName, "UNKNOWN THREAD2");
  });
  return &unknown[which - 1];
}

}  // namespace

void trcThreadTableLock() { tableLock().lock(); }
void trcThreadTableUnlock() { tableLock().unlock(); }

void trcSetThreadData(const trcThreadData* entry) {
  uint32_t key = entry->threadId;
  trcThreadData* stored = nullptr;
  bool inA = true;
  int index = static_cast<int>(key % TRC_THREAD_SLOTS);
  trcThreadTableLock();
  initialise();
  if (g_tableA[index].key == TRC_FREE_KEY || g_tableA[index].key == key) {
    stored = &g_tableA[index];
    fill(stored, entry);
  } else {
    inA = false;
    bool known = false;
    for (int i = 0; i < g_countB && !known; ++i) known = g_tableB[i].key == key;
    if (!known) {
      // Once 149 entries are used, new ids take the last one in turn.
      index = g_countB;
      stored = &g_tableB[index];
      fill(stored, entry);
      g_countB = std::min(g_countB + 1, TRC_THREAD_SLOTS - 1);
    }
  }
  g_inUse = true;
  trcThreadData copy;
  if (stored != nullptr) copy = *stored;
  trcThreadTableUnlock();

  if (stored == nullptr || !trcIsRunning()) return;
  trcBlockHeader* b = trcint::enterBlock();
  if (b == nullptr) return;
  trcLockBuffer(b);
  (inA ? b->threadTable : b->threadOverflow)[index] = copy;
  trcUnlockBuffer(b);
  trcint::leaveBlock();
}

void trcSetThreadName(const char* name) {
  trcThreadData e;
  memset(&e, 0, sizeof e);
  e.threadId = trcint::threadId();
  if (name != nullptr) memcpy(e.threadName, name, strnlen(name, sizeof e.threadName));
  trcSetThreadData(&e);
}

const trcThreadData* trcGetThreadData(uint32_t threadId) {
  std::lock_guard<std::recursive_mutex> hold(tableLock());
  initialise();
  const trcThreadData& slot = g_tableA[threadId % TRC_THREAD_SLOTS];
  if (slot.key == TRC_FREE_KEY || threadId == TRC_FREE_KEY) return substitute(1);
  if (slot.key == threadId) return &slot;
  for (int i = 0; i < TRC_THREAD_SLOTS && g_tableB[i].key != TRC_FREE_KEY; ++i)
    if (g_tableB[i].key == threadId) return &g_tableB[i];
  return substitute(2);
}

bool trcThreadTablesInUse() {
  std::lock_guard<std::recursive_mutex> hold(tableLock());
  return g_inUse;
}

void trcLoadThreadTables(const trcBlockHeader* header) {
  std::lock_guard<std::recursive_mutex> hold(tableLock());
  memcpy(g_tableA, header->threadTable, sizeof g_tableA);
  memcpy(g_tableB, header->threadOverflow, sizeof g_tableB);
  g_countB = 0;
  while (g_countB < TRC_THREAD_SLOTS - 1 && g_tableB[g_countB].key != TRC_FREE_KEY) ++g_countB;
  g_initialised = true;
}

void trcCopyThreadTables(trcBlockHeader* block) {
  std::lock_guard<std::recursive_mutex> hold(tableLock());
  initialise();
  memcpy(block->threadTable, g_tableA, sizeof g_tableA);
  memcpy(block->threadOverflow, g_tableB, sizeof g_tableB);
}

void trcClearThreadTables(trcBlockHeader* block) {
  std::lock_guard<std::recursive_mutex> hold(tableLock());
  g_initialised = false;
  initialise();
  setFree(block->threadTable);
  setFree(block->threadOverflow);
}
