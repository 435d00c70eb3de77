// The process's trace anchor and the life of a shared trace block: creating
// it (the trace control command), attaching a server to it at start-up or on
// the trace-on notice, noticing that it was turned off, letting go of it, the
// version check, the printable key, and the thread data tables that let a
// formatter in another process name the server's threads.
#pragma once

#include <cstdint>

#include "common/env/klpenv.h"
#include "common/trace/trcblock.h"

// Result codes.
constexpr int TRC_RC_NO_ADDRESS = 1000;   // the block has no address
constexpr int TRC_RC_NO_MEMORY = 1003;    // the platform had no memory for the block
constexpr int TRC_RC_INCOMPATIBLE = 1004; // the block is of another structure version
constexpr int TRC_RC_NOT_CREATED = 3000;  // a block is held and not Stop, or creation failed

// Seconds a server keeps a block that was turned off before it lets go.
constexpr int TRC_STOP_GRACE_SECONDS = 60;

// Copies a key part (at most 1039 characters, NUL-ended); src may be dst.
void trcCopyKey(char (&dst)[TRC_KEY_SIZE], const char* src);

// Points the anchor at its static storage, zeroes it, sets state Initial and
// the process id. First thing in a program's main routine.
void trcInitAnchor();
// The anchor, or null while trcInitAnchor was never called.
trcAnchor* trcGetAnchor();

// Declares this process the traced application (the server), after
// trcInitAnchor. Only the application marks a block application-attached
// and withdraws the mark, and records its version block, module list and
// thread tables in it. Any other process that attaches (the command
// program, the trace command) traces its own points into the block and
// leaves all of that, and the freeing of a block the application holds,
// alone.
void trcDeclareApplication();

// Server side: attaches to the block "<keyPart1><keyPart2>.TRC" when one is
// on and Running, records the program's version block and module list in it
// (when given, in the application) and starts tracing. 0 (also when no trace is on), 1000 or 1004.
int trcAttach(const char* keyPart1, const char* keyPart2, const klpAppVersion* appVersion,
              const klpModuleList* moduleList);
// Stops tracing and lets go of the block: destroys this process's hold when
// the block's status is Stop and the application no longer holds it,
// detaches otherwise.
void trcDetach();
// On every pass of a server's command loop: once the block is Stop, stops
// writing, and lets go of it more than 60 seconds later.
void trcCheckStop();
// Destroys this process's hold on the block, clears the address, Stopped.
void trcFree();
// Lets go of the block without touching its flags: waits until no trace
// point of this process is still writing into it, then destroys (destroy) or
// detaches the handle. The anchor's state is left to the caller.
void trcDropBlock(bool destroy);

// Opens the existing block of the two key parts: derives its id, attaches
// (the platform refuses a block of another user or open to others), and
// checks that it is at least a header long.
// ECF_OK with *memory and *block set; ECF_NOT_FOUND when there is none;
// another platform code when it exists but may not be used.
hsvRC trcOpenBlock(const char* keyPart1, const char* keyPart2, HSVHIPCMemory** memory,
                   trcBlockHeader** block);

// Starts tracing into the block this process holds: the application copies
// its thread tables into it and marks it attached; the anchor is Running.
void trcStartTracing(trcBlockHeader* block);

// Records a block opened with trcOpenBlock as this process's own: handle and
// address go into the anchor, so the trace points of this process write
// into it once the anchor is Running, and trcDropBlock lets go of it.
void trcHoldBlock(HSVHIPCMemory* memory, trcBlockHeader* block);

// Control side: creates and initialises a block of bufferSize bytes and
// attaches this process to it (Running). fileName: trace directly to that
// file (null or empty: not). standalone: called from the trace command in a
// process of its own rather than from inside the server.
// 0, 1000, 1003 or 3000.
int trcCreate(uint32_t bufferSize, const char* keyPart1, const char* keyPart2,
              const char* fileName, uint32_t maxFileSize, uint16_t globalFilter, bool standalone);

// Compatible when the platform is "Linux", the structure version "0012", and
// the counts at most 54 and 250. With report: an incompatible header prints
// the incompatible-version message, a different symbol table the warning
// (still compatible); the words are "File" and fileName, or "Shared" "buffer"
// when fileName is null.
bool trcCheckVersion(const trcBlockHeader* header, const char* fileName, bool report);

// The printable IPC key of the block of the two key parts: a malloc'ed text
// of at most 261 characters for the caller to free, or null.
char* trcKeyText(const char* keyPart1, const char* keyPart2);

// Tells the server of the two key parts that something happened to its
// trace (function code 10: the trace was turned on). 0 sent or no server to
// tell; otherwise the failure was printed.
int _trcSendIPCMsg(const char* keyPart1, const char* keyPart2, int function);

// Thread data tables -------------------------------------------------------

// Stores a thread's entry in this process's tables (the key is the thread
// id) and, while tracing, in the block's copy of them.
void trcSetThreadData(const trcThreadData* entry);
// Fills an entry for the calling thread with its id, id text and name (at
// most 64 bytes) and stores it.
void trcSetThreadName(const char* name);
// The entry of a thread id in this process's tables, or a substitute entry
// named "UNKNOWN THREAD1" / "UNKNOWN THREAD2". Never null.
const trcThreadData* trcGetThreadData(uint32_t threadId);
// True once this process stored or loaded an entry.
bool trcThreadTablesInUse();
// Replaces this process's tables by those of a header (a formatter that has
// none of its own names the traced threads from them).
void trcLoadThreadTables(const trcBlockHeader* header);
// Copies this process's tables into a block, under the thread-table lock.
void trcCopyThreadTables(trcBlockHeader* block);
// Sets every entry of a block's tables and of this process's own free.
void trcClearThreadTables(trcBlockHeader* block);
// The thread-table lock: process-local, recursive.
void trcThreadTableLock();
void trcThreadTableUnlock();
