// Resource ids: a path names the same queue or shared-memory block in every
// process because the POSIX name is a hash of the path's bytes. The hash is
// 64-bit FNV-1a so that programs in other languages can compute it too.
#include <cinttypes>
#include <cstdio>
#include <cstring>

#include "common/platform/hsv.h"
#include "common/platform/hsv_internal.h"

namespace {

constexpr uint64_t kFnvOffsetBasis = 0xcbf29ce484222325ULL;
constexpr uint64_t kFnvPrime = 0x100000001b3ULL;

uint64_t fnv1a64(const char* s) {
  uint64_t h = kFnvOffsetBasis;
  for (const unsigned char* p = reinterpret_cast<const unsigned char*>(s); *p; ++p) {
    h ^= *p;
    h *= kFnvPrime;
  }
  return h;
}

hsvRC makeID(const char* path, int option, const char* kind, const char* prefix, hsvFaultOp op,
             HSVResID* out) {
  if (!out) return ECF_INVALID_ARGUMENT;
  if (!path || !*path) return ECF_INVALID_ARGUMENT;
  if (hsvRC f = hsvint::faultCheck(op)) return f;
  HSVResID id{};
  snprintf(id.part1, sizeof id.part1, "%s", kind);
  snprintf(id.part2, sizeof id.part2, "/%s.%016" PRIx64, prefix, fnv1a64(path));
  snprintf(id.part3, sizeof id.part3, "%d", option);
  *out = id;
  return ECF_OK;
}

// Length of a part that may lack its NUL (an id copied from elsewhere).
int partLen(const char* part, size_t cap) { return static_cast<int>(strnlen(part, cap)); }

}  // namespace

hsvRC hsvIPCGetQueResID(const char* path, int option, HSVResID* out) {
  return makeID(path, option, "mqueue", "klpq", HSV_FAULT_RESID_QUEUE, out);
}

hsvRC hsvIPCGetResID(const char* path, int option, HSVResID* out) {
  return makeID(path, option, "shm", "klpm", HSV_FAULT_RESID_MEMORY, out);
}

void hsvResIDPrintable(const HSVResID& id, char* buf, size_t bufLen) {
  if (!buf || bufLen == 0) return;
  snprintf(buf, bufLen, "(%.*s, %.*s, %.*s)", partLen(id.part1, sizeof id.part1), id.part1,
           partLen(id.part2, sizeof id.part2), id.part2, partLen(id.part3, sizeof id.part3),
           id.part3);
}

bool hsvint::posixName(const HSVResID& id, char (&name)[sizeof(HSVResID::part2)]) {
  size_t n = strnlen(id.part2, sizeof id.part2);
  if (n < 2 || n >= sizeof id.part2 || id.part2[0] != '/') return false;
  if (memchr(id.part2 + 1, '/', n - 1)) return false;
  memcpy(name, id.part2, n + 1);
  return true;
}
