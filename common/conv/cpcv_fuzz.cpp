// cpcv over arbitrary bytes and CCSID pairs: the first bytes choose the pair,
// the flags and the room of the caller's buffer; the rest is the data. The
// output buffer is exactly as large as the room given, so a write past it is
// caught by the address sanitizer.
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <vector>

#include "common/conv/convmgr.h"

namespace {

const uint32_t kCcsids[] = {37,   273,  500,  834,  864,  930,  933,   939,   943,   1047,
                            1200, 1208, 1252, 1363, 1386, 1392, 13488, 17586, 12345, 0};

uint32_t pick(uint8_t b) { return kCcsids[b % (sizeof kCcsids / sizeof kCcsids[0])]; }

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static ConvMgr* mgr = new ConvMgr(8);
  if (size < 5) return 0;
  uint32_t from = pick(data[0]), to = pick(data[1]);
  uint8_t flags = data[2];
  size_t room = static_cast<size_t>(data[3]) * 4 + data[4] % 4;
  const char* in = reinterpret_cast<const char*>(data + 5);
  size_t len = size - 5;

  // A null target asks the manager for its own output: keep one byte even
  // when the room is 0.
  std::vector<char> out(room ? room : 1);
  const char* s = in;
  char* t = out.data();
  int rc = mgr->cpcv(from, &s, in + len, to, &t, out.data() + room, 0, flags & 1, 1, flags & 2,
                     0, flags & 4, flags & 8);
  if (rc == 0 && (t < out.data() || t > out.data() + room)) __builtin_trap();

  // The manager's own output and the value forms.
  s = in;
  char* own = nullptr;
  mgr->cpcv(from, &s, in + len, to, &own, nullptr, 0, flags & 1, 1, flags & 2, flags & 16, 1, 1);
  int16_t vlen = static_cast<int16_t>(room);
  t = out.data();
  mgr->cpcvc(from, in, to, &vlen, &t, static_cast<int32_t>(len) / ((flags & 2) ? 2 : 1), 0,
             (flags & 2) != 0, (flags & 32) != 0);
  ConvRunBuf rb{out.data(), 0, static_cast<int32_t>(room)};
  mgr->cpcvb(from, to, in, static_cast<int32_t>(len), &rb, 0);
  if (rb.used < 0 || static_cast<size_t>(rb.used) > room) __builtin_trap();
  mgr->releaseOutputs();
  return 0;
}
