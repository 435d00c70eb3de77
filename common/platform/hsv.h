// Platform services: the one narrow layer between the run-time and the
// operating system. Every inter-process object, clock, lock, library load and
// trap dump goes through here; nothing else in the code base calls these OS
// services directly. Failures are nonzero platform codes (ECF_*), never
// exceptions; print them as "0x%X" with ecfErrorGetDescription().
#pragma once

#include <cstddef>
#include <cstdint>
#include <ctime>
#include <new>

// ---------------------------------------------------------------------------
// Platform codes
// ---------------------------------------------------------------------------
typedef uint32_t hsvRC;

constexpr hsvRC ECF_OK = 0;
constexpr hsvRC ECF_ACCESS_DENIED = 0x90000001;
constexpr hsvRC ECF_NOT_FOUND = 0x90000002;       // no such queue / block / library / symbol
constexpr hsvRC ECF_INVALID_ARGUMENT = 0x90000003;
constexpr hsvRC ECF_INVALID_VERSION = 0x90000004;
constexpr hsvRC ECF_ALREADY_EXISTS = 0x90000005;
constexpr hsvRC ECF_NOT_ATTACHED = 0x90000006;    // operation on an object not created/attached
constexpr hsvRC ECF_MSG_TOO_BIG = 0x90000007;     // put longer than the queue's maximum message
constexpr hsvRC ECF_BUFFER_TOO_SMALL = 0x90000008;
constexpr hsvRC ECF_DEADLOCK = 0x90000009;
constexpr hsvRC ECF_QUEUE_FULL = 0x9000000A;      // put still blocked after the bounded wait
constexpr hsvRC ECF_INTERRUPTED = 0x9000000B;
constexpr hsvRC ECF_LIMIT_REACHED = 0x9000000C;   // system limit on queues / memory reached
constexpr hsvRC ECF_NO_MEMORY = 0x9000000D;
constexpr hsvRC ECF_NOT_OWNED = 0x9000000E;       // object of another user, or open to group/others
constexpr hsvRC ECF_TIMEOUT = 0x90000013;
constexpr hsvRC ECF_SEM_WAIT_ABANDONED = 0x90000080;
constexpr hsvRC ECF_SYSTEM_ERROR = 0x900000FF;    // any other errno
constexpr hsvRC ECF_WAITPOST_NOT_INITIALIZED = 0x900003FF;
constexpr hsvRC ECF_WAITPOST_NOT_POSTED = 0x90000400;
constexpr hsvRC ECF_WAITPOST_RESET = 0x90000401;

// A readable text for a platform code; never null, static storage.
const char* ecfErrorGetDescription(hsvRC code);
// The platform code for an errno value (ENOENT -> ECF_NOT_FOUND, ...;
// anything without a closer code -> ECF_SYSTEM_ERROR).
hsvRC hsvErrnoToECF(int err);

// ---------------------------------------------------------------------------
// Resource ids: derived from a path, identical in every process.
// ---------------------------------------------------------------------------
constexpr int HSV_QUEUE_RESID_OPTION = 48;
constexpr int HSV_MEMORY_RESID_OPTION = 109;
constexpr int HSV_CREATE_OPTION = 51;
constexpr size_t HSV_MAX_MSG_SIZE = 4096;
constexpr long HSV_QUEUE_DEPTH = 10;          // messages a queue holds before put waits
constexpr int32_t HSV_PUT_WAIT_MS = 30000;    // how long put waits for room

struct HSVResID {
  char part1[16];       // object kind: "mqueue" or "shm"
  char part2[40];       // the POSIX object name, e.g. "/klpq.0123456789abcdef"
  char part3[24];       // the option value the id was derived with, decimal
  const char* posixName() const { return part2; }
};

// path -> queue id (option 48) / shared-memory id (option 109).
// ECF_INVALID_ARGUMENT for a null or empty path.
hsvRC hsvIPCGetQueResID(const char* path, int option, HSVResID* out);
hsvRC hsvIPCGetResID(const char* path, int option, HSVResID* out);
// "(%s, %s, %s)" of the three parts, cut to bufLen-1 characters and NUL-ended.
void hsvResIDPrintable(const HSVResID& id, char* buf, size_t bufLen);

// ---------------------------------------------------------------------------
// Platform objects made on the heap are allocated by the platform layer, so
// that a test can make the allocation fail (hsv_fault.h): a nothrow new
// answers null, a plain one throws std::bad_alloc, as when memory runs out.
// ---------------------------------------------------------------------------
struct HSVHeapObject {
  static void* operator new(size_t size);
  static void* operator new(size_t size, const std::nothrow_t&) noexcept;
  static void operator delete(void* p) noexcept;
  static void operator delete(void* p, const std::nothrow_t&) noexcept;
};

// ---------------------------------------------------------------------------
// Inter-process message queue (POSIX message queue, mode 0600).
// ---------------------------------------------------------------------------
class HSVHIPCQueue : public HSVHeapObject {
 public:
  HSVHIPCQueue();
  ~HSVHIPCQueue();  // closes the descriptor; never destroys the queue
  HSVHIPCQueue(const HSVHIPCQueue&) = delete;
  HSVHIPCQueue& operator=(const HSVHIPCQueue&) = delete;

  // Creates the queue (ECF_ALREADY_EXISTS when one of ours exists,
  // ECF_NOT_OWNED when the name is taken by an object that is not private to
  // us) and keeps it open. An object that already holds a queue answers
  // ECF_INVALID_ARGUMENT.
  hsvRC create(const HSVResID& id, size_t maxMsgSize, int option);
  // Attaches to an existing queue; ECF_NOT_FOUND while none exists,
  // ECF_NOT_OWNED when it belongs to another user or is open to group or
  // others (names are predictable, so anyone could have made it first).
  hsvRC attach(const HSVResID& id);
  hsvRC detach();   // closes the descriptor, queue stays
  hsvRC destroy();  // closes and removes the queue from the system
  // Puts one whole message. When the queue is full, waits up to 30 s for room
  // (ECF_QUEUE_FULL after that); ECF_MSG_TOO_BIG above the message size.
  hsvRC put(const void* buf, size_t len);
  // put with a chosen wait for room (negative: forever, 0: not at all).
  hsvRC putWait(const void* buf, size_t len, int32_t waitMs);
  // Takes one whole message, waiting up to timeoutMs (negative: forever).
  // ECF_TIMEOUT when none came; ECF_BUFFER_TOO_SMALL when capacity is below
  // the queue's message size.
  hsvRC get(void* buf, size_t capacity, size_t* outLen, int32_t timeoutMs);
  // True when a message is waiting; answers at once.
  bool hasMessage();
  // Waits up to timeoutMs until a message is waiting, without taking it.
  // ECF_OK when one is there, ECF_TIMEOUT otherwise.
  hsvRC waitForMessage(int32_t timeoutMs);
  bool isOpen() const { return fd_ >= 0; }
  const HSVResID& resID() const { return id_; }
  // The queue's maximum message size (0 while not open).
  size_t maxMsgSize() const { return msgSize_; }

 private:
  int fd_ = -1;
  size_t msgSize_ = 0;
  HSVResID id_{};
};

// ---------------------------------------------------------------------------
// Inter-process shared memory (POSIX shared memory, mode 0600).
// ---------------------------------------------------------------------------
class HSVHIPCMemory : public HSVHeapObject {
 public:
  HSVHIPCMemory();
  ~HSVHIPCMemory();  // unmaps; never destroys the block
  HSVHIPCMemory(const HSVHIPCMemory&) = delete;
  HSVHIPCMemory& operator=(const HSVHIPCMemory&) = delete;

  // Both answer ECF_NOT_OWNED for a block that is not private to us, as the
  // queue does.
  hsvRC create(const HSVResID& id, size_t size, int option);  // zero-filled
  hsvRC attach(const HSVResID& id);                           // ECF_NOT_FOUND when none
  void* getAddress() const { return addr_; }
  size_t getSize() const { return size_; }
  hsvRC detach();
  // Unmaps and removes the name while it still names this block (not one
  // made under the same name since); attached processes keep their mapping.
  hsvRC destroy();

 private:
  void* addr_ = nullptr;
  size_t size_ = 0;
  HSVResID id_{};
  uint64_t dev_ = 0, ino_ = 0;  // the object this handle maps
};

// ---------------------------------------------------------------------------
// Wait/post object (process-local event that counts its posts).
// A post while nobody waits is remembered until a wait consumes it.
// ---------------------------------------------------------------------------
class HSVHIPCWaitpost : public HSVHeapObject {
 public:
  HSVHIPCWaitpost();
  ~HSVHIPCWaitpost();
  HSVHIPCWaitpost(const HSVHIPCWaitpost&) = delete;
  HSVHIPCWaitpost& operator=(const HSVHIPCWaitpost&) = delete;

  hsvRC create(int option);
  // 0 when posted, ECF_TIMEOUT when timeMs passed, ECF_WAITPOST_NOT_INITIALIZED
  // before create / after destroy. Negative timeMs waits forever.
  hsvRC wait(int32_t timeMs);
  hsvRC post();
  // Wakes the threads still waiting (they answer ECF_WAITPOST_NOT_INITIALIZED)
  // and returns once they have left; no wait may start after it.
  hsvRC destroy();

 private:
  struct Impl;
  Impl* impl_ = nullptr;
};

// ---------------------------------------------------------------------------
// Byte locks across processes (a byte in shared memory).
// ---------------------------------------------------------------------------
// Atomic exchange of 1 into the byte; answers the previous value (0: taken).
uint8_t hsvByteLockExchange(volatile uint8_t* lock);
// Waits (yielding, then sleeping briefly) until the exchange succeeds.
void hsvByteLockConflict(volatile uint8_t* lock);
// Takes the lock: exchange, and on conflict wait.
inline void hsvByteLock(volatile uint8_t* lock) {
  if (hsvByteLockExchange(lock) != 0) hsvByteLockConflict(lock);
}
// Release stores 0.
void hsvByteLockRelease(volatile uint8_t* lock);

// ---------------------------------------------------------------------------
// Ids, time, sleep, one-time initialisation
// ---------------------------------------------------------------------------
int32_t hsvProcessID();
uint64_t hsvThreadID();  // kernel thread id of the caller

struct HSVTimeUTC {
  int64_t seconds;       // since the epoch
  int32_t microseconds;  // 0..999999
};
HSVTimeUTC hsvTimeGetUTC();
// Broken-down time of UTC seconds; false when the conversion failed.
bool hsvTimeLocalTime(int64_t seconds, struct tm* out);
bool hsvTimeGmTime(int64_t seconds, struct tm* out);
void hsvSleep(uint32_t milliseconds);
// One-time initialisation of the platform layer in this process; idempotent
// and thread-safe.
hsvRC hsvOneTimeOnly();

// ---------------------------------------------------------------------------
// Processes
// ---------------------------------------------------------------------------
// Starts program (a bare name is looked for in the directory of this
// process's executable first, then on PATH) with argv, argv[0] included and
// null-terminated, by posix_spawn: in a session of its own, its standard
// streams on /dev/null, inheriting nothing else of the caller's state worth
// holding on to. ECF_OK with *pid set; ECF_NOT_FOUND when it cannot be run.
hsvRC hsvStartProcess(const char* program, const char* const* argv, int32_t* pid);
// Waits for a process this one started; its exit code in *exitCode (-1 when
// a signal ended it).
hsvRC hsvWaitProcess(int32_t pid, int* exitCode);

// ---------------------------------------------------------------------------
// Shared libraries (dlopen)
// ---------------------------------------------------------------------------
class HSVSharedLib : public HSVHeapObject {
 public:
  HSVSharedLib();
  ~HSVSharedLib();  // unloads when loaded
  HSVSharedLib(const HSVSharedLib&) = delete;
  HSVSharedLib& operator=(const HSVSharedLib&) = delete;

  // option 4: resolve lazily, local; 0: resolve now. ECF_NOT_FOUND when it
  // cannot be loaded; lastError() then holds the loader's text and
  // lastErrno() the error number (ENOEXEC for a path to a file that is no
  // library, ENOENT for a name the search finds nothing for).
  hsvRC load(const char* name, int option);
  void* getFuncAddress(const char* symbol);  // null when absent
  // The same with a code: ECF_NOT_FOUND for a symbol the library lacks,
  // ECF_NOT_ATTACHED while nothing is loaded; *address is null then.
  hsvRC getFuncAddress(const char* symbol, void** address);
  hsvRC unload();
  bool isLoaded() const { return handle_ != nullptr; }
  const char* lastError() const { return err_; }
  int lastErrno() const { return errno_; }

 private:
  void* handle_ = nullptr;
  int errno_ = 0;
  char err_[256] = {0};
};

// ---------------------------------------------------------------------------
// Trap file: a dump file that is appended to.
// ---------------------------------------------------------------------------
constexpr int HSV_TRAPFILE_OPEN_OPTION = 20;
constexpr int HSV_TRAPFILE_DUMP_OPTION = 507911;

// The first stack walk loads the unwinder, which allocates: a process that
// may dump from a signal handler calls this early, outside any handler.
// Costs a shared-library load, so short-lived programs skip it.
void hsvTrapFilePrepare();
// Writes one line naming the signal, the process and the thread to standard
// error; async-signal-safe, for a handler that is about to let a fault end
// the process.
void hsvTrapLine(int signalNumber, const char* threadName);

class HSVTrapFile : public HSVHeapObject {
 public:
  HSVTrapFile();
  ~HSVTrapFile();  // closes
  HSVTrapFile(const HSVTrapFile&) = delete;
  HSVTrapFile& operator=(const HSVTrapFile&) = delete;

  hsvRC open(const char* path, int option);  // create or open for append, mode 0600
  hsvRC seekToEnd();
  bool isValid() const { return fd_ >= 0; }
  hsvRC write(const void* buf, size_t len);
  // Writes a readable dump: signal, process and thread ids, time, the
  // fault address when siginfo is given, and the calling thread's stack trace
  // (async-signal-safe: backtrace_symbols_fd).
  hsvRC dump(int option, int signalNumber, const void* siginfo, const void* ucontext);
  hsvRC close();

 private:
  int fd_ = -1;
};
