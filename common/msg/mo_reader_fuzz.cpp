// Arbitrary bytes as a catalogue image: refused, or texts read from inside it only.
#include <cstddef>
#include <cstdint>

#include "common/msg/msglogger.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  msgMoCatalog* catalog = msgMoParse(data, size, nullptr);
  if (catalog == nullptr) return 0;  // refused: handled like an unreadable file
  static const char* const keys[] = {"", "500", "506", "589", "7112", "7193", "8999"};
  char* values[3] = {const_cast<char*>("app"), const_cast<char*>(""), const_cast<char*>("v3")};
  char out[1025];
  for (const char* key : keys) {
    size_t len = 0;
    const char* text = msgMoLookup(catalog, key, &len);
    if (text == nullptr) continue;
    // Touch every byte so a bad view shows up under the sanitizers.
    volatile uint8_t sum = 0;
    for (size_t i = 0; i < len; ++i) sum = static_cast<uint8_t>(sum + static_cast<uint8_t>(text[i]));
    int n = msgSubstitute(text, len, values, 3, out, 1024);
    if (n < 0 || n > 1024 || out[n] != '\0') __builtin_trap();
  }
  msgMoFree(catalog);
  return 0;
}
