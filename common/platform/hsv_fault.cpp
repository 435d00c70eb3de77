// Fault injection for tests (see hsv_fault.h), and the one allocator of the
// platform's heap objects, through which an allocation can be made to fail.
#include "common/platform/hsv_fault.h"

#include <errno.h>
#include <fcntl.h>
#include <pthread.h>
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <new>

#include "common/platform/hsv_internal.h"

#ifndef KLP_FAULTS

bool hsvFaultCompiledIn() { return false; }
bool hsvFaultArm(const char*) { return false; }
uint32_t hsvFaultUses(hsvFaultOp) { return 0; }

#else

namespace {

struct OpInfo {
  const char* name;
  hsvRC code;  // what a failure answers: the real call's code for it
};
const OpInfo kOps[HSV_FAULT_OPS] = {
    {"alloc", ECF_NO_MEMORY},
    {"resid.queue", ECF_INVALID_ARGUMENT},
    {"resid.memory", ECF_INVALID_ARGUMENT},
    {"queue.create", ECF_LIMIT_REACHED},
    {"queue.attach", ECF_LIMIT_REACHED},
    {"queue.put", ECF_QUEUE_FULL},
    {"queue.get", ECF_TIMEOUT},
    {"queue.hasMessage", ECF_SYSTEM_ERROR},
    {"queue.waitForMessage", ECF_TIMEOUT},
    {"memory.create", ECF_LIMIT_REACHED},
    {"memory.attach", ECF_LIMIT_REACHED},
    {"waitpost.create", ECF_NO_MEMORY},
    {"waitpost.wait", ECF_TIMEOUT},
    {"waitpost.post", ECF_WAITPOST_NOT_INITIALIZED},
    {"lib.load", ECF_NOT_FOUND},
    {"lib.getFuncAddress", ECF_NOT_FOUND},
    {"process.start", ECF_NOT_FOUND},
    {"process.wait", ECF_SYSTEM_ERROR},
    {"trapfile.open", ECF_LIMIT_REACHED},
    {"trapfile.write", ECF_LIMIT_REACHED},
};

constexpr int kMaxRules = 32;

struct Rule {
  hsvFaultOp op;
  uint32_t first;
  uint32_t last;  // 0: every use from first on
  hsvRC code;
};

struct Config {
  bool active = false;  // armed or logging: uses are counted
  int ruleCount = 0;
  Rule rules[kMaxRules];
  uint32_t sleepDivisor = 1;
  uint32_t waitDivisor = 1;
  int logFd = -1;
};

Config g_config;
std::atomic<uint32_t> g_uses[HSV_FAULT_OPS];
pthread_once_t g_once = PTHREAD_ONCE_INIT;

const char* programName() { return program_invocation_short_name; }

bool parseNumber(const char* s, const char* end, uint32_t* out) {
  if (s == end) return false;
  char* stop = nullptr;
  errno = 0;
  unsigned long v = strtoul(s, &stop, 0);
  if (stop != end || errno != 0 || v > UINT32_MAX) return false;
  *out = static_cast<uint32_t>(v);
  return true;
}

// "operation:use[-last|+][=code]", kept in c when keep is set.
bool parseRule(const char* s, const char* end, Config* c, bool keep) {
  const char* colon = static_cast<const char*>(memchr(s, ':', static_cast<size_t>(end - s)));
  if (colon == nullptr) return false;
  int op = 0;
  while (op < HSV_FAULT_OPS && !(strlen(kOps[op].name) == static_cast<size_t>(colon - s) &&
                                 strncmp(kOps[op].name, s, static_cast<size_t>(colon - s)) == 0))
    ++op;
  if (op == HSV_FAULT_OPS) return false;
  Rule r{static_cast<hsvFaultOp>(op), 0, 0, kOps[op].code};
  const char* p = colon + 1;
  const char* eq = static_cast<const char*>(memchr(p, '=', static_cast<size_t>(end - p)));
  const char* rangeEnd = eq != nullptr ? eq : end;
  if (eq != nullptr && (!parseNumber(eq + 1, end, &r.code) || r.code == ECF_OK)) return false;
  const char* dash = static_cast<const char*>(memchr(p, '-', static_cast<size_t>(rangeEnd - p)));
  if (rangeEnd > p && rangeEnd[-1] == '+') {
    if (!parseNumber(p, rangeEnd - 1, &r.first)) return false;
  } else if (dash != nullptr) {
    if (!parseNumber(p, dash, &r.first) || !parseNumber(dash + 1, rangeEnd, &r.last) ||
        r.last < r.first)
      return false;
  } else {
    if (!parseNumber(p, rangeEnd, &r.first)) return false;
    r.last = r.first;
  }
  if (r.first == 0 || (keep && c->ruleCount == kMaxRules)) return false;
  if (keep) c->rules[c->ruleCount++] = r;
  return true;
}

// An item, after an optional "program/" that keeps it to the program of
// that name: an item for another program is checked but changes nothing.
bool parseItem(const char* s, const char* end, Config* c, bool keep) {
  size_t head = strcspn(s, "/=:,");
  if (s + head < end && s[head] == '/') {
    bool ours = strlen(programName()) == head && strncmp(programName(), s, head) == 0;
    return parseItem(s + head + 1, end, c, keep && ours);
  }
  auto valueOf = [&](const char* key) -> const char* {
    size_t n = strlen(key);
    return static_cast<size_t>(end - s) > n && strncmp(s, key, n) == 0 ? s + n : nullptr;
  };
  uint32_t divisor = 0;
  if (const char* v = valueOf("log=")) {
    char path[4096];
    size_t n = static_cast<size_t>(end - v);
    if (n >= sizeof path) return false;
    if (!keep) return true;
    memcpy(path, v, n);
    path[n] = '\0';
    if (c->logFd >= 0) close(c->logFd);
    c->logFd = open(path, O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600);
    return c->logFd >= 0;
  }
  if (const char* v = valueOf("sleep=")) {
    if (!parseNumber(v, end, &divisor) || divisor == 0) return false;
    if (keep) c->sleepDivisor = divisor;
    return true;
  }
  if (const char* v = valueOf("wait=")) {
    if (!parseNumber(v, end, &divisor) || divisor == 0) return false;
    if (keep) c->waitDivisor = divisor;
    return true;
  }
  return parseRule(s, end, c, keep);
}

// Parses the whole text into c; on failure names the item on standard
// error, leaves c disarmed and answers false.
bool parseSpec(const char* spec, Config* c) {
  *c = Config{};
  for (const char* s = spec; *s != '\0';) {
    const char* end = strchr(s, ',');
    if (end == nullptr) end = s + strlen(s);
    if (end > s && !parseItem(s, end, c, true)) {
      fprintf(stderr, "KLP_TEST_FAULTS: cannot use \"%.*s\"\n", static_cast<int>(end - s), s);
      if (c->logFd >= 0) close(c->logFd);
      *c = Config{};
      return false;
    }
    s = *end == ',' ? end + 1 : end;
  }
  c->active = true;
  return true;
}

void loadFromEnvironment() {
  const char* spec = getenv("KLP_TEST_FAULTS");
  if (spec != nullptr && *spec != '\0') parseSpec(spec, &g_config);
}

const Config& config() {
  pthread_once(&g_once, loadFromEnvironment);
  return g_config;
}

// Appends the decimal digits of v; async-signal-safe, as the line may be
// written from a signal handler's dump.
char* putNumber(char* p, uint64_t v) {
  char digits[24];
  int n = 0;
  do {
    digits[n++] = static_cast<char>('0' + v % 10);
    v /= 10;
  } while (v != 0);
  while (n > 0) *p++ = digits[--n];
  return p;
}

char* putText(char* p, const char* s, size_t max) {
  for (size_t i = 0; i < max && s[i] != '\0'; ++i) *p++ = s[i];
  return p;
}

void logUse(int fd, hsvFaultOp op, uint32_t use, bool fails) {
  char line[160];
  char* p = putText(line, programName(), 64);
  *p++ = ' ';
  p = putNumber(p, static_cast<uint64_t>(getpid()));
  *p++ = ' ';
  p = putText(p, kOps[op].name, 32);
  *p++ = ' ';
  p = putNumber(p, use);
  if (fails) p = putText(p, " fails", 8);
  *p++ = '\n';
  ssize_t ignored = write(fd, line, static_cast<size_t>(p - line));
  (void)ignored;
}

}  // namespace

bool hsvFaultCompiledIn() { return true; }

bool hsvFaultArm(const char* spec) {
  pthread_once(&g_once, loadFromEnvironment);  // the variable no longer overrides
  if (g_config.logFd >= 0) close(g_config.logFd);
  g_config = Config{};
  for (auto& u : g_uses) u.store(0, std::memory_order_relaxed);
  return spec == nullptr || parseSpec(spec, &g_config);
}

uint32_t hsvFaultUses(hsvFaultOp op) { return g_uses[op].load(std::memory_order_relaxed); }

hsvRC hsvint::faultCheck(hsvFaultOp op) {
  const Config& c = config();
  if (__builtin_expect(!c.active, 1)) return ECF_OK;
  uint32_t use = g_uses[op].fetch_add(1, std::memory_order_relaxed) + 1;
  hsvRC rc = ECF_OK;
  for (int i = 0; i < c.ruleCount && rc == ECF_OK; ++i) {
    const Rule& r = c.rules[i];
    if (r.op == op && use >= r.first && (r.last == 0 || use <= r.last)) rc = r.code;
  }
  if (c.logFd >= 0) logUse(c.logFd, op, use, rc != ECF_OK);
  return rc;
}

uint32_t hsvint::faultSleepMs(uint32_t ms) { return ms / config().sleepDivisor; }

int32_t hsvint::faultWaitMs(int32_t ms) {
  return ms < 0 ? ms : static_cast<int32_t>(ms / static_cast<int64_t>(config().waitDivisor));
}

#endif  // KLP_FAULTS

// ---------------------------------------------------------------------------
// Heap objects of the platform layer
// ---------------------------------------------------------------------------
void* HSVHeapObject::operator new(size_t size) {
  if (hsvint::faultCheck(HSV_FAULT_ALLOC) != ECF_OK) throw std::bad_alloc();
  return ::operator new(size);
}

void* HSVHeapObject::operator new(size_t size, const std::nothrow_t&) noexcept {
  if (hsvint::faultCheck(HSV_FAULT_ALLOC) != ECF_OK) return nullptr;
  return ::operator new(size, std::nothrow);
}

void HSVHeapObject::operator delete(void* p) noexcept { ::operator delete(p); }

void HSVHeapObject::operator delete(void* p, const std::nothrow_t&) noexcept {
  ::operator delete(p);
}
