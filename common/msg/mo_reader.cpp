// Our own reader of the message catalogue, a GNU MO file: every count and
// offset in it is checked against the file size, and a damaged file is
// handled like an unreadable one.
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <mutex>
#include <new>
#include <string>
#include <string_view>

#include "common/msg/msglogger.h"

#ifndef KLP_BUILD_DIR
#define KLP_BUILD_DIR "."
#endif

struct msgMoCatalog {
  std::string image;                                  // the whole file
  std::map<std::string_view, std::string_view> byId;  // views into image
};

namespace {

constexpr uint32_t kMagic = 0x950412de;
constexpr uint32_t kMagicSwapped = 0xde120495;
constexpr size_t kMaxCatalogBytes = 64u << 20;  // far beyond any real catalogue

enum { REASON_MISSING = 2, REASON_UNREADABLE = 3, REASON_NO_MESSAGE = 4, REASON_BAD_CALL = 5 };

uint32_t read32(const uint8_t* p, bool swap) {
  uint32_t v;
  memcpy(&v, p, sizeof v);
  if (swap) v = __builtin_bswap32(v);
  return v;
}

// Checks a (length, offset) descriptor at table + 8 * index: the string and
// its NUL must lie inside the image.
bool readString(const uint8_t* data, size_t size, uint64_t table, uint32_t index, bool swap,
                std::string_view* out) {
  uint64_t at = table + 8ull * index;
  if (at + 8 > size) return false;
  uint32_t len = read32(data + at, swap);
  uint32_t off = read32(data + at + 4, swap);
  if (static_cast<uint64_t>(off) + len + 1 > size) return false;
  *out = std::string_view(reinterpret_cast<const char*>(data) + off, len);
  return true;
}

struct CacheEntry {
  msgMoCatalog* catalog = nullptr;
  int reason = 0;
  std::string detail;
};

std::mutex cacheLock;
std::map<std::string, CacheEntry>* cache = nullptr;

bool fileExists(const std::string& path) { return access(path.c_str(), F_OK) == 0; }

std::string exeDir() {
  char buf[4096];
  ssize_t n = readlink("/proc/self/exe", buf, sizeof buf - 1);
  if (n <= 0) return "";
  buf[n] = '\0';
  char* slash = strrchr(buf, '/');
  if (slash == nullptr) return "";
  slash[1] = '\0';
  return buf;
}

std::string joinDir(const std::string& dir, const char* name) {
  if (dir.empty()) return "";
  return dir.back() == '/' ? dir + name : dir + "/" + name;
}

// Where the catalogue lives: KLP_CATALOG_DIR, the program's directory, then
// the build tree's bin/. A name with a '/' is taken as it is.
std::string locate(const char* name) {
  if (strchr(name, '/') != nullptr) return name;
  const char* env = getenv("KLP_CATALOG_DIR");
  std::string candidates[3] = {env != nullptr && *env != '\0' ? joinDir(env, name) : "",
                               joinDir(exeDir(), name), joinDir(KLP_BUILD_DIR "/bin", name)};
  for (const std::string& c : candidates)
    if (!c.empty() && fileExists(c)) return c;
  return "";
}

void load(const char* name, CacheEntry* entry) {
  std::string path = locate(name);
  if (path.empty()) {
    entry->reason = REASON_MISSING;
    entry->detail = std::string("file not found: ") + name;
    return;
  }
  FILE* f = fopen(path.c_str(), "rb");
  if (f == nullptr) {
    int err = errno;
    entry->reason = err == ENOENT ? REASON_MISSING : REASON_UNREADABLE;
    entry->detail = path + ": " + strerror(err);
    return;
  }
  std::string image;
  char buf[65536];
  size_t n;
  bool tooBig = false;
  while ((n = fread(buf, 1, sizeof buf, f)) > 0) {
    if (image.size() + n > kMaxCatalogBytes) {
      tooBig = true;
      break;
    }
    image.append(buf, n);
  }
  bool readError = ferror(f) != 0;
  fclose(f);
  if (readError || tooBig) {
    entry->reason = REASON_UNREADABLE;
    entry->detail = path + (tooBig ? ": file too large" : ": read error");
    return;
  }
  int reason = 0;
  entry->catalog = msgMoParse(reinterpret_cast<const uint8_t*>(image.data()), image.size(),
                              &reason);
  if (entry->catalog == nullptr) {
    entry->reason = reason != 0 ? reason : REASON_UNREADABLE;
    entry->detail = path + ": not a valid message catalogue";
  }
}

int fail(char* buffer, int bufferSize, int reason, const std::string& detail) {
  if (buffer != nullptr && bufferSize > 0)
    snprintf(buffer, static_cast<size_t>(bufferSize), "CATALOG:  %d  %s", reason, detail.c_str());
  return -reason;
}

}  // namespace

msgMoCatalog* msgMoParse(const uint8_t* data, size_t size, int* reason) {
  if (reason != nullptr) *reason = REASON_UNREADABLE;
  if (data == nullptr || size < 28) return nullptr;
  uint32_t magic;
  memcpy(&magic, data, sizeof magic);
  bool swap;
  if (magic == kMagic)
    swap = false;
  else if (magic == kMagicSwapped)
    swap = true;
  else
    return nullptr;
  uint32_t revision = read32(data + 4, swap);
  if ((revision >> 16) != 0) return nullptr;  // a major revision we do not know
  uint32_t count = read32(data + 8, swap);
  uint64_t origTable = read32(data + 12, swap);
  uint64_t transTable = read32(data + 16, swap);
  if (origTable + 8ull * count > size || transTable + 8ull * count > size) return nullptr;
  msgMoCatalog* cat = new (std::nothrow) msgMoCatalog;
  if (cat == nullptr) return nullptr;
  try {
    cat->image.assign(reinterpret_cast<const char*>(data), size);
    const uint8_t* img = reinterpret_cast<const uint8_t*>(cat->image.data());
    for (uint32_t i = 0; i < count; ++i) {
      std::string_view id, text;
      if (!readString(img, size, origTable, i, swap, &id) ||
          !readString(img, size, transTable, i, swap, &text)) {
        delete cat;
        return nullptr;
      }
      cat->byId.emplace(id, text);  // the first of duplicate ids wins
    }
  } catch (...) {
    delete cat;
    return nullptr;
  }
  if (reason != nullptr) *reason = 0;
  return cat;
}

const char* msgMoLookup(const msgMoCatalog* catalog, const char* key, size_t* len) {
  if (catalog == nullptr || key == nullptr) return nullptr;
  auto it = catalog->byId.find(std::string_view(key));
  if (it == catalog->byId.end()) return nullptr;
  if (len != nullptr) *len = it->second.size();
  return it->second.data();
}

void msgMoFree(msgMoCatalog* catalog) { delete catalog; }

void msgCatalogReset() {
  std::lock_guard<std::mutex> guard(cacheLock);
  if (cache == nullptr) return;
  for (auto& kv : *cache) delete kv.second.catalog;
  delete cache;
  cache = nullptr;
}

int retrieveCatalogMsg(const char* catalogName, int number, const uint64_t* valueLengths,
                       char* const* values, int count, char* buffer, int bufferSize) {
  (void)valueLengths;  // values are NUL-terminated; their lengths are not trusted
  if (buffer == nullptr || bufferSize < 2 || catalogName == nullptr || *catalogName == '\0')
    return fail(buffer, bufferSize, REASON_BAD_CALL, "invalid call");
  const msgMoCatalog* catalog = nullptr;
  {
    std::lock_guard<std::mutex> guard(cacheLock);
    try {
      if (cache == nullptr) cache = new std::map<std::string, CacheEntry>;
      auto it = cache->find(catalogName);
      if (it == cache->end()) {
        CacheEntry entry;
        load(catalogName, &entry);
        it = cache->emplace(catalogName, std::move(entry)).first;
      }
      if (it->second.catalog == nullptr)
        return fail(buffer, bufferSize, it->second.reason, it->second.detail);
      catalog = it->second.catalog;
    } catch (...) {
      return fail(buffer, bufferSize, REASON_UNREADABLE, "out of memory");
    }
  }
  char key[16];
  snprintf(key, sizeof key, "%d", number);
  size_t len = 0;
  const char* text = msgMoLookup(catalog, key, &len);
  if (text == nullptr || len == 0)
    return fail(buffer, bufferSize, REASON_NO_MESSAGE,
                std::string("message ") + key + " not in " + catalogName);
  if (count < 0) count = 0;
  if (count > MSG_MAX_VALUES) count = MSG_MAX_VALUES;
  int n = msgSubstitute(text, len, values, count, buffer, bufferSize - 1);
  return n > 0 ? n : fail(buffer, bufferSize, REASON_NO_MESSAGE, "empty message");
}
