// The SQL descriptor snapshot.
#include "common/util/sqlda.h"

#include <cinttypes>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "common/util/klprc.h"

namespace {

constexpr int kHeaderSize = 16;
constexpr int kEntrySize = 56;

}  // namespace

int snapDAAlloc(sqlda** out, int n) {
  *out = nullptr;
  if (n < 0 || n > SQLDA_MAX_ENTRIES) return KLP_RC_BAD_PARM;
  // calloc of at least a whole header and one entry keeps the struct's
  // one-entry array in bounds for an area of 0 entries.
  size_t size = kHeaderSize + kEntrySize * static_cast<size_t>(n > 0 ? n : 1);
  sqlda* da = static_cast<sqlda*>(calloc(1, size));
  if (!da) {
    printf("snapDA: malloc failed\n");
    return KLP_RC_NO_MEMORY;
  }
  memcpy(da->sqldaid, "SQLDA   ", 8);
  da->sqldabc = kHeaderSize + kEntrySize * n;
  da->sqln = static_cast<int16_t>(n);
  da->sqld = static_cast<int16_t>(n);
  *out = da;
  return 0;
}

sqlda* snapDAAllocTypedPtr(sqlda** out, int n, const uint32_t* types) {
  if (snapDAAlloc(out, n) != 0) return nullptr;
  for (int i = 0; i < n && types; ++i) {
    (*out)->sqlvar[i].sqltype = static_cast<int16_t>(types[i] >> 16);
    (*out)->sqlvar[i].sqllen = static_cast<int16_t>(types[i] & 0xFFFF);
  }
  return *out;
}

int snapDAAllocTyped(sqlda** out, int n, const uint32_t* types) {
  return snapDAAllocTypedPtr(out, n, types) ? n : -1;
}

void snapDAPrint(sqlda** da) {
  if (!da || !*da) return;
  const sqlda* a = *da;
  printf("SQLDA at %016" PRIX64 ": sqldaid='%8.8s'; ",
         static_cast<uint64_t>(reinterpret_cast<uintptr_t>(a)), a->sqldaid);
  printf("sqldabc=%4d; sqln=%4d; sqld=%4d\n", a->sqldabc, a->sqln, a->sqld);
  for (int i = 0; i < a->sqln; ++i) {
    const sqlvar& v = a->sqlvar[i];
    printf("   [%2d] sqltype=%3d; sqllen=%3d; sqldata=%016" PRIX64 "; sqlind=%016" PRIX64 "\n", i,
           v.sqltype, v.sqllen, static_cast<uint64_t>(reinterpret_cast<uintptr_t>(v.sqldata)),
           static_cast<uint64_t>(reinterpret_cast<uintptr_t>(v.sqlind)));
  }
}

void snapDAFree(sqlda** da) {
  if (!da) return;
  free(*da);
  *da = nullptr;
}
