// The thread wrapper: one klpThread per operating-system thread of a program,
// with name, state, command interests, command list, recovery manager,
// database connections and end code. Threads live on a thread list (OrdList);
// the process thread-id list maps OS thread ids back to their klpThread.
#pragma once

#include <pthread.h>

#include <cstdint>

#include "common/thread/ordlist.h"
#include "common/thread/recoverymgr.h"

// Thread states (numeric values are part of the status data).
enum : int32_t {
  KLP_THREAD_EXIST = 1,
  KLP_THREAD_START = 2,
  KLP_THREAD_INIT = 3,
  KLP_THREAD_RUN = 4,
  KLP_THREAD_REST = 5,
  KLP_THREAD_STOP = 6,
  KLP_THREAD_WAIT = 7,
  KLP_THREAD_DBWAIT = 8,
};

// Supervisor and stop results beyond klprc.h.
enum : int {
  KLP_RC_NO_CRITICAL = 415,     // threads alive, none critical
  KLP_RC_THREAD_FINISHED = 2006,
  KLP_RC_NONE_ALIVE = 2007,
  KLP_RC_TERMINATED = 2001,     // end code of a terminated thread
  KLP_RC_SHUTDOWN = 2012,
  KLP_RC_NO_MANAGER = 602,      // caller is no registered thread
};

constexpr int KLP_THREAD_NAME_MAX = 14;
constexpr int KLP_CMD_CODES = 64;
constexpr size_t KLP_THREAD_STACK = 323072;
constexpr uint32_t KLP_STOP_WAIT_MS = 2001;
constexpr uint32_t KLP_STOP_ALL_WAIT_MS = 1001;
constexpr int KLP_DB_NAME_MAX = 33;

class klpThread;
typedef void (*klpThreadRoutine)(klpThread* thread);

// A database connection as the thread sees it. No database is behind the
// base class: it records interrupts and closes; real connection classes
// derive from it.
class klpDbConn {
 public:
  klpDbConn(char kind, const char* dbName, int32_t codePage);
  virtual ~klpDbConn();
  virtual int interrupt();  // cancels the statement in progress
  virtual int close();
  bool matches(char kind, const char* dbName, int32_t codePage) const;

  char kind;                          // 'O', 'D', ...
  char dbName[KLP_DB_NAME_MAX + 1];
  int32_t codePage;
  int32_t isOpen = 1;
  int32_t interrupts = 0;
  klpDbConn* next = nullptr;          // next older connection of the thread
};

// The thread's database context ("KlpCtxE").
struct klpDbCtx {
  OrdListElement ole;
  char dbAlias[KLP_DB_NAME_MAX + 1];  // blank-filled
  int32_t interrupts;
  void init();
  int interrupt();
};

class klpThread {
 public:
  OrdListElement ole;  // "KlpThrd": links the thread into a thread list
  OrdListElement tid;  // "KlpThID": object = this; on the thread-id list
  char name[16];
  int32_t state;
  int32_t restart;
  int32_t critical;
  klpThreadRoutine startRoutine;
  int32_t reserved;
  pthread_t handle;
  int32_t hasHandle;  // the handle is only meaningful while this is set
  int32_t cmdInterest[KLP_CMD_CODES];
  uint64_t threadId;
  klpDbCtx dbCtx;
  OrdList dbCtxList;  // "KlpDbCtxList"
  OrdList* sharedCmdList;
  OrdList* cmdList;   // own command list, or the shared one
  recoveryMgr rcvyMgr;
  void* userData;     // malloc'ed; freed at thread end
  int32_t endCode;
  void* workBuffer;   // malloc'ed; freed when the thread is removed
  klpDbConn* conns;   // open connections, most recent first
  klpDbConn* curConn;
  // Guards conns and curConn: a stop interrupts the thread's work from
  // another thread while the thread may be opening or closing connections.
  pthread_mutex_t connLock;

  klpThread();
  ~klpThread();
  klpThread(const klpThread&) = delete;
  klpThread& operator=(const klpThread&) = delete;

  void setName(const char* n);  // cut to 14 characters
  // State and end code are read by other threads without a lock: use these
  // (atomic) accessors when another thread may be changing them.
  int32_t getState() const { return __atomic_load_n(&state, __ATOMIC_ACQUIRE); }
  void setState(int32_t s) { __atomic_store_n(&state, s, __ATOMIC_RELEASE); }
  int32_t getEndCode() const { return __atomic_load_n(&endCode, __ATOMIC_ACQUIRE); }
  void setEndCode(int32_t c) { __atomic_store_n(&endCode, c, __ATOMIC_RELEASE); }
  // Fatal unless both eye-catchers are intact.
  void check(const char* where) const;

  static int start(klpThread* thread, OrdList* list);  // 0 or 802
  static int prologue(klpThread* thread);              // 0 or the manager's code
  static int stop(klpThread* thread);
  static void print(klpThread* thread);

  // Database connections (no database behind them here).
  klpDbConn* getCurDbConn() const { return curConn; }
  // Finds an open connection by kind, name (33 characters) and code page;
  // for kind 'O' one is created and registered when none matches.
  klpDbConn* getThrdCtlConn(char kind, const char* dbName, int32_t codePage);
  klpDbConn* connect(char kind, const char* dbName, int32_t codePage);
  int disconnect(klpDbConn* conn);
  int swapTo(klpDbConn* conn);
  klpDbConn* detachCurrentConn();
  void cleanupConns();  // closes and frees every connection
  int interruptDbWork();
};

// Creates and starts a thread; *code 0, 801 or 802.
klpThread* createThread(int* code, OrdList* list, klpThreadRoutine routine, const char* name,
                        const char* dbAlias, int restart, void* userData, int useSharedCmdList,
                        int critical);
// Ends the calling thread with the code (0 -> 2011 stored); the main thread
// ends the process with 12 (non-zero code) or 0. Does not return.
[[noreturn]] void threadEnd(klpThread* thread, int code);
int stopAll(OrdList* list);  // 0 or 2009
int supervise(OrdList* list, int stopping, int* highestEndCode);
int threadStateByName(OrdList* list, const char* name);  // 0 when none
klpThread* currentThread();
int interestedInCmd(klpThread* thread, int code);
void setCmdInterest(klpThread* thread, int code, int value);

// Texts of a state: "EXIST"... for traces, "exists"... for messages.
const char* threadStateWord(int32_t state);
const char* threadStateText(int32_t state);

// Sleeps as "resting" (state 5 unless it is 8), then restores the state.
void klpRestingSleep(uint32_t milliseconds);

// The klpThread of a thread-list or thread-id-list element.
klpThread* klpThreadOf(OrdListElement* e);

// Process-wide objects.
klpThread* klpMainThread();
OrdList* klpThreadIdList();
OrdList* klpSharedCmdList();
