// Our own reader of the message catalogue, a GNU MO file: every count and
// offset in it is checked against the file size, and a damaged file is
// handled like an unreadable one. Lookups are by message number only.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <mutex>
#include <new>
#include <string>
#include <string_view>
#include <vector>

#include "common/msg/msglogger.h"

#ifndef KLP_DATA_DIR
#define KLP_DATA_DIR "/usr/local/share/klp"
#endif
// The data directory as seen from the programs' directory, so that an
// installed tree moved to another prefix still finds its catalogue.
#ifndef KLP_DATA_DIR_FROM_BIN
#define KLP_DATA_DIR_FROM_BIN "../share/klp"
#endif

// The texts a lookup can find, by message number. Only decimal ids of
// message numbers are kept, so the index stays small whatever the file holds.
struct msgMoEntry {
  int number;
  std::string_view text;  // a view into image
};

struct msgMoCatalog {
  std::string image;                // the whole file
  std::vector<msgMoEntry> byNumber;  // ascending; one entry per number
};

namespace {

constexpr uint32_t kMagic = 0x950412de;
constexpr uint32_t kMagicSwapped = 0xde120495;
constexpr size_t kMaxCatalogBytes = 64u << 20;  // far beyond any real catalogue
// Message numbers have four digits, so a real catalogue holds at most 10000
// texts besides its header; a file claiming many more is not one of ours.
constexpr uint32_t kMaxCatalogEntries = 1u << 16;

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

// The message number an id names as "%d" would print it (one to four digits,
// no leading zero), or -1.
int idNumber(std::string_view id) {
  if (id.empty() || id.size() > 4 || (id[0] == '0' && id.size() > 1)) return -1;
  int n = 0;
  for (char c : id) {
    if (c < '0' || c > '9') return -1;
    n = n * 10 + (c - '0');
  }
  return n;
}

// A text must begin with its own id ("KLP0504E" for 504): the logger reads
// the severity from it, and a text filed under the wrong number would be
// issued for a message it does not describe.
bool beginsWithOwnId(int number, std::string_view text) {
  if (text.size() < 8 || text.compare(0, 3, "KLP") != 0) return false;
  for (int i = 6; i >= 3; --i, number /= 10)
    if (text[i] != '0' + number % 10) return false;
  return text[7] != '\0' && strchr("IWED", text[7]) != nullptr;
}

// Indexes the catalogue's image; false when it is damaged.
bool indexImage(msgMoCatalog* cat) {
  const uint8_t* data = reinterpret_cast<const uint8_t*>(cat->image.data());
  size_t size = cat->image.size();
  if (size < 28) return false;
  uint32_t magic;
  memcpy(&magic, data, sizeof magic);
  bool swap;
  if (magic == kMagic)
    swap = false;
  else if (magic == kMagicSwapped)
    swap = true;
  else
    return false;
  uint32_t revision = read32(data + 4, swap);
  if ((revision >> 16) != 0) return false;  // a major revision we do not know
  uint32_t count = read32(data + 8, swap);
  uint64_t origTable = read32(data + 12, swap);
  uint64_t transTable = read32(data + 16, swap);
  if (count > kMaxCatalogEntries) return false;
  if (origTable + 8ull * count > size || transTable + 8ull * count > size) return false;
  try {
    for (uint32_t i = 0; i < count; ++i) {
      std::string_view id, text;
      if (!readString(data, size, origTable, i, swap, &id) ||
          !readString(data, size, transTable, i, swap, &text))
        return false;
      int number = idNumber(id);
      if (number >= 0 && beginsWithOwnId(number, text)) cat->byNumber.push_back({number, text});
    }
    // The first of duplicate ids wins.
    auto before = [](const msgMoEntry& a, const msgMoEntry& b) { return a.number < b.number; };
    std::stable_sort(cat->byNumber.begin(), cat->byNumber.end(), before);
    auto same = [](const msgMoEntry& a, const msgMoEntry& b) { return a.number == b.number; };
    cat->byNumber.erase(std::unique(cat->byNumber.begin(), cat->byNumber.end(), same),
                        cat->byNumber.end());
  } catch (...) {
    return false;
  }
  return true;
}

// Parses an image the catalogue takes over.
msgMoCatalog* parseImage(std::string&& image, int* reason) {
  if (reason != nullptr) *reason = REASON_UNREADABLE;
  msgMoCatalog* cat = new (std::nothrow) msgMoCatalog;
  if (cat == nullptr) return nullptr;
  cat->image = std::move(image);
  if (!indexImage(cat)) {
    delete cat;
    return nullptr;
  }
  if (reason != nullptr) *reason = 0;
  return cat;
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

// Where the catalogue lives: KLP_CATALOG_DIR, the program's directory, the
// data directory beside it, then the configured data directory. A name with
// a '/' is taken as it is.
std::string locate(const char* name) {
  if (strchr(name, '/') != nullptr) return name;
  const char* env = getenv("KLP_CATALOG_DIR");
  std::string dir = exeDir();
  std::string candidates[4] = {env != nullptr && *env != '\0' ? joinDir(env, name) : "",
                               joinDir(dir, name),
                               joinDir(joinDir(dir, KLP_DATA_DIR_FROM_BIN), name),
                               joinDir(KLP_DATA_DIR, name)};
  for (const std::string& c : candidates)
    if (!c.empty() && fileExists(c)) return c;
  return "";
}

// Reads a regular file of at most kMaxCatalogBytes. Opened without blocking:
// a FIFO or device under the catalogue's name must not hold the first
// message up forever.
int readCatalogFile(const std::string& path, std::string* image, std::string* detail) {
  int fd = open(path.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC);
  if (fd < 0) {
    int err = errno;
    *detail = path + ": " + strerror(err);
    return err == ENOENT ? REASON_MISSING : REASON_UNREADABLE;
  }
  struct stat st{};
  int reason = 0;
  if (fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
    *detail = path + ": not a regular file";
    reason = REASON_UNREADABLE;
  } else if (static_cast<uint64_t>(st.st_size) > kMaxCatalogBytes) {
    *detail = path + ": file too large";
    reason = REASON_UNREADABLE;
  } else {
    image->resize(static_cast<size_t>(st.st_size));
    size_t got = 0;
    while (got < image->size()) {
      ssize_t n = read(fd, image->data() + got, image->size() - got);
      if (n < 0 && errno == EINTR) continue;
      if (n < 0) {
        *detail = path + ": read error";
        reason = REASON_UNREADABLE;
      }
      if (n <= 0) break;
      got += static_cast<size_t>(n);
    }
    image->resize(got);  // a file cut short while we read parses as damaged
  }
  close(fd);
  return reason;
}

void load(const char* name, CacheEntry* entry) {
  std::string path = locate(name);
  if (path.empty()) {
    entry->reason = REASON_MISSING;
    entry->detail = std::string("file not found: ") + name;
    return;
  }
  std::string image;
  entry->reason = readCatalogFile(path, &image, &entry->detail);
  if (entry->reason != 0) return;
  int reason = 0;
  entry->catalog = parseImage(std::move(image), &reason);
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
  if (data == nullptr) return nullptr;
  try {
    return parseImage(std::string(reinterpret_cast<const char*>(data), size), reason);
  } catch (...) {
    return nullptr;
  }
}

const char* msgMoLookup(const msgMoCatalog* catalog, const char* key, size_t* len) {
  if (catalog == nullptr || key == nullptr) return nullptr;
  int number = idNumber(key);
  if (number < 0) return nullptr;
  auto it = std::lower_bound(
      catalog->byNumber.begin(), catalog->byNumber.end(), number,
      [](const msgMoEntry& e, int n) { return e.number < n; });
  if (it == catalog->byNumber.end() || it->number != number) return nullptr;
  if (len != nullptr) *len = it->text.size();
  return it->text.data();
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
