// The message catalogue: our MO reader on hand-made and damaged images, the
// built catalogue's contents, and the logger's use of it (fallback and the
// one-time KLP0513E when it cannot be opened).
#include <gtest/gtest.h>

#include <sys/stat.h>

#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <functional>
#include <string>
#include <utility>
#include <vector>

#include "common/msg/msg_testing.h"
#include "common/msg/msglogger.h"

namespace {

const std::string kBuiltCatalog = std::string(KLP_BIN_DIR) + "/vdbklp.mo";

void put32(std::vector<uint8_t>& b, size_t at, uint32_t v, bool big) {
  for (int i = 0; i < 4; ++i)
    b[at + (big ? 3 - i : i)] = static_cast<uint8_t>(v >> (8 * i));
}

// A minimal MO image of the given (id, text) pairs.
std::vector<uint8_t> moImage(const std::vector<std::pair<std::string, std::string>>& entries,
                             bool big = false) {
  uint32_t n = static_cast<uint32_t>(entries.size());
  size_t orig = 28, trans = orig + 8 * n, strings = trans + 8 * n;
  std::vector<uint8_t> b(strings, 0);
  put32(b, 0, 0x950412de, big);
  put32(b, 8, n, big);
  put32(b, 12, static_cast<uint32_t>(orig), big);
  put32(b, 16, static_cast<uint32_t>(trans), big);
  for (uint32_t i = 0; i < n; ++i) {
    const std::string* s[2] = {&entries[i].first, &entries[i].second};
    size_t table[2] = {orig, trans};
    for (int k = 0; k < 2; ++k) {
      put32(b, table[k] + 8 * i, static_cast<uint32_t>(s[k]->size()), big);
      put32(b, table[k] + 8 * i + 4, static_cast<uint32_t>(b.size()), big);
      b.insert(b.end(), s[k]->begin(), s[k]->end());
      b.push_back(0);
    }
  }
  return b;
}

std::string lookup(const std::vector<uint8_t>& image, const char* key) {
  int reason = -1;
  msgMoCatalog* c = msgMoParse(image.data(), image.size(), &reason);
  if (c == nullptr) return "<damaged " + std::to_string(reason) + ">";
  size_t len = 0;
  const char* t = msgMoLookup(c, key, &len);
  std::string out = t != nullptr ? std::string(t, len) : "<none>";
  msgMoFree(c);
  return out;
}

int reasonOf(const char* errorText) {
  const char* colon = strchr(errorText, ':');
  return colon != nullptr && strlen(colon) >= 3 ? atoi(colon + 3) : -1;
}

// In either byte order, only a decimal message number finds a text, and only
// a text that begins with its own id: anything else in the file is passed
// over.
TEST(MoReader, OnlyDecimalIdsWithTheirOwnTextsAreFound) {
  std::vector<std::pair<std::string, std::string>> entries = {
      {"", "KLP0000E header"},       {"0500", "KLP0500E leading zero"},
      {"abc", "KLP0500E letters"},   {"500", "KLP0500E first"},
      {"500", "KLP0500E second"},    {"501", "KLP0500E filed under 501"},
      {"502", "KLP0502X severity"},  {"503", "KLP0503"},
      {"504", "hello"},              {"12345", "KLP2345E five digits"},
      {"7", "KLP0007W seven"},       {"9999", "KLP9999D last"}};
  const std::pair<const char*, const char*> rows[] = {
      {"500", "KLP0500E first"}, {"7", "KLP0007W seven"}, {"9999", "KLP9999D last"},
      {"", "<none>"},            {"0", "<none>"},         {"0500", "<none>"},
      {"abc", "<none>"},         {"501", "<none>"},       {"502", "<none>"},
      {"503", "<none>"},         {"504", "<none>"},       {"12345", "<none>"},
      {"2345", "<none>"},        {"-1", "<none>"},
  };
  for (bool big : {false, true}) {
    auto img = moImage(entries, big);
    for (const auto& [key, want] : rows) EXPECT_EQ(want, lookup(img, key)) << key << " " << big;
  }
}

TEST(MoReader, DamagedImagesAreRefusedWithoutReadingOutside) {
  auto good = moImage({{"500", "KLP0500E first"}, {"501", "KLP0501E second"}});
  EXPECT_EQ("KLP0501E second", lookup(good, "501"));
  // Every truncation of the image is refused.
  for (size_t cut = 0; cut < good.size(); ++cut) {
    std::vector<uint8_t> part(good.begin(), good.begin() + cut);
    EXPECT_EQ("<damaged 3>", lookup(part, "500")) << cut;
  }
  struct Row {
    const char* what;
    size_t at;
    uint32_t value;
  };
  const Row rows[] = {
      {"magic", 0, 0x12345678},
      {"unknown major revision", 4, 0x00010000},
      {"count far beyond the file", 8, 0xFFFFFFFF},
      {"table offset beyond the file", 16, 0xFFFFFFF0},
      {"string offset wrapping in 32 bits", 28 + 8 + 4, 0xFFFFFFF8},
      {"string length beyond the file", 28 + 16, 0x7FFFFFFF},
  };
  for (const Row& r : rows) {
    auto bad = good;
    put32(bad, r.at, r.value, false);
    EXPECT_EQ("<damaged 3>", lookup(bad, "500")) << r.what;
  }
  // Far more entries than message numbers exist, every one of them sound
  // (empty strings at offset 0): refused before any is read.
  constexpr uint32_t kCount = 70000;
  std::vector<uint8_t> many(28 + 16 * kCount, 0);
  put32(many, 0, 0x950412de, false);
  put32(many, 8, kCount, false);
  put32(many, 12, 28, false);
  put32(many, 16, 28 + 8 * kCount, false);
  EXPECT_EQ("<damaged 3>", lookup(many, "500"));
}

TEST(Catalogue, BuiltFileHoldsEveryIssuedNumber) {
  int required[] = {500, 501, 502, 503, 504, 506, 507, 508, 509, 510, 511, 513, 514, 517,
                    518, 519, 520, 521, 522, 523, 524, 525, 526, 527, 529, 534, 541, 543,
                    545, 552, 554, 568, 569, 574, 575, 589, 590, 591, 592, 593, 594, 595,
                    596, 597, 598, 599, 600, 601, 602, 606, 615, 616, 617, 619, 624, 626,
                    7112, 7113, 7114, 7115, 7116, 7117, 7118, 7119, 7120, 7121, 7122, 7123,
                    7124, 7193};
  for (int number : required) {
    SCOPED_TRACE(number);
    char text[1100];
    int n = retrieveCatalogMsg(kBuiltCatalog.c_str(), number, nullptr, nullptr, 0, text,
                               sizeof text);
    ASSERT_GT(n, 0) << text;
    char id[8];
    snprintf(id, sizeof id, "KLP%04d", number);
    ASSERT_EQ(0, strncmp(text, id, 7)) << text;
    ASSERT_NE(nullptr, strchr("EIW", text[7])) << text;
    if ((number >= 7112 && number <= 7124) || number == 7193) {
      // The status report cuts the first ten characters: id and two blanks.
      EXPECT_EQ(0, strncmp(text + 8, "  ", 2)) << text;
      EXPECT_NE(' ', text[10]) << text;
    } else {
      // Header values come first: application name, then qualifier-and-thread.
      EXPECT_EQ(0, strncmp(text + 8, "  \"*\" : \"*\" : ", 14)) << text;
    }
    // Markers must stand in ascending order, or the later ones stay unsubstituted.
    char v[9][3] = {"v1", "v2", "v3", "v4", "v5", "v6", "v7", "v8", "v9"};
    char* values[9] = {v[0], v[1], v[2], v[3], v[4], v[5], v[6], v[7], v[8]};
    uint64_t lengths[9] = {2, 2, 2, 2, 2, 2, 2, 2, 2};
    n = retrieveCatalogMsg(kBuiltCatalog.c_str(), number, lengths, values, 9, text, sizeof text);
    ASSERT_GT(n, 0) << text;
    for (const char* p = text; (p = strchr(p, '$')) != nullptr; ++p)
      EXPECT_FALSE(p[1] >= '1' && p[1] <= '9') << "unsubstituted marker in " << text;
  }
}

TEST(Catalogue, ValuesAreSubstitutedAndReasonsReported) {
  char* values[4] = {const_cast<char*>("App"), const_cast<char*>("KLP\" : \"T"),
                     const_cast<char*>("PARM"), const_cast<char*>("")};
  char text[200];
  int n = retrieveCatalogMsg(kBuiltCatalog.c_str(), 500, nullptr, values, 4, text, sizeof text);
  EXPECT_STREQ("KLP0500E  \"App\" : \"KLP\" : \"T\" : The value \"PARM\" of the parameter \"*\" "
               "is not valid.",
               text);
  EXPECT_EQ(static_cast<int>(strlen(text)), n);

  char small[12];
  memset(small, '#', sizeof small);
  n = retrieveCatalogMsg(kBuiltCatalog.c_str(), 500, nullptr, values, 4, small, 8);
  EXPECT_EQ(7, n);
  EXPECT_STREQ("KLP0500", small);
  EXPECT_EQ('#', small[8]);

  EXPECT_LE(retrieveCatalogMsg(kBuiltCatalog.c_str(), 4999, nullptr, nullptr, 0, text,
                               sizeof text),
            0);
  EXPECT_EQ(4, reasonOf(text));
  EXPECT_LE(retrieveCatalogMsg("/no/such/dir/vdbklp.mo", 500, nullptr, nullptr, 0, text,
                               sizeof text),
            0);
  EXPECT_EQ(2, reasonOf(text)) << text;
  EXPECT_NE(':', text[0]);
}

// What stands under the catalogue's name in KLP_CATALOG_DIR: only a regular,
// whole file is used, nothing there blocks, and a text filed under another
// number is not found (the logger then takes the built-in text).
TEST(Catalogue, OnlyARegularSoundFileFromTheDirectoryVariableIsUsed) {
  std::string image = klptest::readFile(kBuiltCatalog);
  ASSERT_GT(image.size(), 100u);
  auto write = [](const std::string& file, const std::string& bytes) {
    FILE* f = fopen(file.c_str(), "wb");
    bool ok = f != nullptr && fwrite(bytes.data(), 1, bytes.size(), f) == bytes.size();
    return f != nullptr && fclose(f) == 0 && ok;
  };
  auto misfiled = moImage({{"500", "KLP0501E filed under 500"}});
  struct Row {
    const char* what;
    std::function<bool(const std::string&)> make;
    int reason;  // 0: the text of 500 was found
  };
  const Row rows[] = {
      {"the whole file", [&](const std::string& f) { return write(f, image); }, 0},
      {"half the file", [&](const std::string& f) { return write(f, image.substr(0, image.size() / 2)); }, 3},
      {"a FIFO", [](const std::string& f) { return mkfifo(f.c_str(), 0600) == 0; }, 3},
      {"a directory", [](const std::string& f) { return mkdir(f.c_str(), 0700) == 0; }, 3},
      {"a text under another number",
       [&](const std::string& f) { return write(f, std::string(misfiled.begin(), misfiled.end())); }, 4},
  };
  for (const Row& r : rows) {
    klptest::TmpDir tmp;
    ASSERT_TRUE(r.make(tmp.path() + "vdbklp.mo")) << r.what;
    auto c = msgtest::inChild(tmp.path(), [&] {
      setenv("KLP_CATALOG_DIR", tmp.path().c_str(), 1);
      msgCatalogReset();
      char text[300];
      int n = retrieveCatalogMsg("vdbklp.mo", 500, nullptr, nullptr, 0, text, sizeof text);
      return n > 0 ? 0 : reasonOf(text);
    }, 10000);
    EXPECT_TRUE(c.finished) << r.what;
    EXPECT_EQ(r.reason, c.exitCode) << r.what;
  }
}

// A program finds the catalogue beside itself or through KLP_CATALOG_DIR,
// never in the build tree it was built in: a copy elsewhere goes without.
TEST(Catalogue, ProgramsLookBesideThemselvesNotInTheBuildTree) {
  klptest::TmpDir tmp;
  std::string built = klptest::binPath("klpkccmd"), copy = tmp.path() + "klpkccmd";
  ASSERT_TRUE(std::filesystem::copy_file(built, copy));
  struct Row {
    std::string program;
    std::vector<std::string> env;
    bool found;
  };
  const Row rows[] = {
      {built, {}, true},
      {copy, {}, false},
      {copy, {"KLP_CATALOG_DIR=" KLP_BIN_DIR}, true},
  };
  for (const Row& r : rows) {
    SCOPED_TRACE(r.program + (r.env.empty() ? "" : " " + r.env[0]));
    auto p = klptest::run({r.program}, r.env);
    EXPECT_EQ(12, p.exitCode);
    EXPECT_EQ(r.found, p.err.find("KLP0513E") == std::string::npos) << p.err;
    EXPECT_EQ(r.found, p.out.find("KLP0589E") != std::string::npos) << p.out;
  }
}

// A logger whose catalogue file does not exist.
struct NoCatalogLogger : msgLoggerU {
  NoCatalogLogger() : msgLoggerU(MSG_APP_KLPKCCMD, 0) {
    snprintf(catalogName_, sizeof catalogName_, "%s", "no-such-catalogue.mo");
  }
};

TEST(Catalogue, LoggerUsesTheCatalogueAndFallsBack) {
  msgCatalogReset();
  msgLogger* u = createMsgLoggerU(MSG_APP_KLPKCCMD, 0);
  ASSERT_NE(nullptr, u);
  u->loadBuiltinMsgs(builtinMsgTable);
  u->setProgramQualifier("KLP");
  char text[1100];
  u->getKlpMsgText(506, "o", "T", text, sizeof text, "Capture Commands");
  EXPECT_STREQ("KLP0506E  \"KlpKCcmd\" : \"KLP\" : \"T\" : The program could not reach the "
               "\"Capture Commands\" queue of the server. The server is not running or its "
               "queue is not available.",
               text);
  u->getKlpMsgText(7123, "N/A", "T", text, sizeof text);
  EXPECT_STREQ("Up", text + 10);
  // Built-in numbers below 8000 that the catalogue lacks come from the table.
  u->getKlpMsgText(661, "o", "T", text, sizeof text);
  EXPECT_STREQ("KLP0661E Job was cancelled", text);
  u->getKlpMsgText(9011, "o", "T", text, sizeof text);
  EXPECT_EQ(0u, std::string(text).find("KLP7654E  \"KlpKCcmd\" : \"KLP\" : \"T\" : The autostop "));
  delete u;
}

TEST(Catalogue, MissingCatalogueIsReportedOnce) {
  klptest::TmpDir tmp;
  auto c = msgtest::inChild(tmp.path(), [&] {
    NoCatalogLogger l;
    l.loadBuiltinMsgs(builtinMsgTable);
    l.setProgramQualifier("KLP");
    l.setLogFileName(tmp.path().c_str(), "test.log");
    l.putKlpMsg(506, MSG_DEST_STDOUT, "o", "T", "Capture Commands");
    l.putKlpMsg(589, MSG_DEST_STDOUT, "o", "T", "a", "1", "b");
    l.putKlpMsg(661, MSG_DEST_STDOUT, "o", "T");
    return 0;
  });
  ASSERT_TRUE(c.finished);
  auto err = msgtest::lines(c.err);
  ASSERT_EQ(1u, err.size()) << c.err;
  EXPECT_NE(std::string::npos,
            err[0].find(" KLP0513E \"KlpKCcmd\":\"KLP\" : \" \": The program could not open the "
                        "message file named 'no-such-catalogue.mo', Reason: "))
      << err[0];
  EXPECT_EQ(2, reasonOf(err[0].c_str() + err[0].find("Reason: ") + 8));
  std::string log = klptest::readFile(tmp.path() + "test.log");
  EXPECT_NE(std::string::npos, log.find("<composeKlpMsg> ")) << log;
  auto out = msgtest::lines(c.out);
  ASSERT_EQ(3u, out.size()) << c.out;
  EXPECT_NE(std::string::npos, out[0].find("KLP0553W")) << out[0];
  EXPECT_NE(std::string::npos, out[0].find("number \"506\""));
  EXPECT_NE(std::string::npos, out[1].find("number \"589\""));
  EXPECT_NE(std::string::npos, out[2].find("KLP0661E Job was cancelled"));
}

}  // namespace
