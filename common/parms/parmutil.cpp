#include "common/parms/parmutil.h"

#include <cctype>
#include <cerrno>
#include <clocale>
#include <cstdlib>
#include <cstring>
#include <cwchar>
#include <cwctype>
#include <locale.h>
#include <vector>

#include "common/parms/klpparm.h"

bool upperKeyword(const char* arg, char* out, size_t* len) {
  size_t n = 0;
  while (arg[n] && arg[n] != '=') {
    if (n == KLP_PARM_NAME_MAX) {
      out[0] = '\0';
      if (len) *len = 0;
      return false;
    }
    out[n] = parmUpper(arg[n]);
    ++n;
  }
  out[n] = '\0';
  if (len) *len = n;
  return true;
}

void upperCopy(const char* text, char* out, size_t outSize) {
  if (outSize == 0) return;
  size_t i = 0;
  for (; text[i] && i + 1 < outSize; ++i) out[i] = parmUpper(text[i]);
  out[i] = '\0';
}

int parseDecimal(const char* text, int32_t* value) {
  errno = 0;
  char* end = nullptr;
  long long v = strtoll(text, &end, 10);
  if (end == text || *end != '\0') return PARM_NUM_GARBAGE;
  if (errno == ERANGE || v > INT32_MAX || v < INT32_MIN) return PARM_NUM_OVERFLOW;
  *value = static_cast<int32_t>(v);
  return PARM_NUM_OK;
}

namespace {

// Switches the calling thread to the user's character classification for
// its lifetime; the thread's previous locale comes back on destruction.
// Only LC_CTYPE matters here, and loading the other categories costs a
// dozen file opens at every start of the command program.
class UserLocale {
 public:
  UserLocale() {
    loc_ = newlocale(LC_CTYPE_MASK, "", static_cast<locale_t>(0));
    if (!loc_) loc_ = newlocale(LC_CTYPE_MASK, "C", static_cast<locale_t>(0));
    if (loc_) old_ = uselocale(loc_);
  }
  ~UserLocale() {
    if (loc_) {
      uselocale(old_);
      freelocale(loc_);
    }
  }
  UserLocale(const UserLocale&) = delete;
  UserLocale& operator=(const UserLocale&) = delete;

 private:
  locale_t loc_ = static_cast<locale_t>(0);
  locale_t old_ = static_cast<locale_t>(0);
};

template <typename Ch, typename IsOk, typename Up>
bool schemaChars(const Ch* v, size_t n, Ch quote, IsOk ok, Up up, std::basic_string<Ch>* out) {
  bool quoted = n >= 2 && v[0] == quote && v[n - 1] == quote;
  size_t from = quoted ? 1 : 0, to = quoted ? n - 1 : n;
  std::basic_string<Ch> r;
  for (size_t i = from; i < to; ++i) {
    if (!ok(v[i])) return false;
    r.push_back(quoted ? v[i] : up(v[i]));
  }
  *out = r;
  return true;
}

}  // namespace

bool applySchemaRule(const char* value, std::string* out) {
  if (!value) value = "";
  size_t len = strlen(value);
  // Plain ASCII classifies and upper-cases alike in every locale: no need
  // to load the user's.
  bool ascii = true;
  for (size_t i = 0; i < len && ascii; ++i) ascii = static_cast<unsigned char>(value[i]) < 0x80;
  if (ascii) {
    auto ok = [](char c) {
      return (c >= '0' && c <= '9') || (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || c == '_';
    };
    auto up = [](char c) { return (c >= 'a' && c <= 'z') ? static_cast<char>(c - 'a' + 'A') : c; };
    return schemaChars<char>(value, len, '"', ok, up, out);
  }
  UserLocale scope;
  mbstate_t st{};
  const char* src = value;
  size_t wlen = mbsrtowcs(nullptr, &src, 0, &st);
  if (wlen == static_cast<size_t>(-1)) return false;  // invalid sequence

  if (wlen == len) {
    auto ok = [](char c) {
      unsigned char u = static_cast<unsigned char>(c);
      return isalnum(u) || c == '_';
    };
    auto up = [](char c) { return static_cast<char>(toupper(static_cast<unsigned char>(c))); };
    return schemaChars<char>(value, len, '"', ok, up, out);
  }

  std::vector<wchar_t> wide(wlen + 1);
  st = mbstate_t{};
  src = value;
  if (mbsrtowcs(wide.data(), &src, wlen + 1, &st) == static_cast<size_t>(-1)) return false;
  std::wstring w;
  auto ok = [](wchar_t c) { return iswalnum(static_cast<wint_t>(c)) || c == L'_'; };
  auto up = [](wchar_t c) { return static_cast<wchar_t>(towupper(static_cast<wint_t>(c))); };
  if (!schemaChars<wchar_t>(wide.data(), wlen, L'"', ok, up, &w)) return false;

  st = mbstate_t{};
  const wchar_t* wsrc = w.c_str();
  size_t blen = wcsrtombs(nullptr, &wsrc, 0, &st);
  if (blen == static_cast<size_t>(-1)) return false;
  std::string back(blen + 1, '\0');
  st = mbstate_t{};
  wsrc = w.c_str();
  if (wcsrtombs(back.data(), &wsrc, blen + 1, &st) == static_cast<size_t>(-1)) return false;
  back.resize(blen);
  *out = back;
  return true;
}
