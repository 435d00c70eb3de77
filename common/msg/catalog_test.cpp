// The message catalogue: the MO reader, the catalogue call and the logger's use of it.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cstring>
#include <fstream>
#include <functional>
#include <string>
#include <vector>

#include "common/msg/msglogger.h"
#include "tests/testing/klptest.h"

namespace {

using Entries = std::vector<std::pair<std::string, std::string>>;
const std::string kCatalog = std::string(KLP_BIN_DIR) + "/vdbklp.mo";
void put32(std::vector<uint8_t>& b, size_t at, uint32_t v, bool big = false) {
  for (int i = 0; i < 4; ++i) b[at + (big ? 3 - i : i)] = static_cast<uint8_t>(v >> (8 * i));
}

// A minimal MO image of the given (id, text) pairs.
std::vector<uint8_t> moImage(const Entries& entries, bool big = false) {
  uint32_t n = static_cast<uint32_t>(entries.size());
  std::vector<uint8_t> b(28 + 16 * n, 0);
  for (auto [at, v] : {std::pair{0u, 0x950412deu}, {8u, n}, {12u, 28u}, {16u, 28 + 8 * n}})
    put32(b, at, v, big);
  for (uint32_t i = 0; i < n; ++i)
    for (uint32_t k = 0; k < 2; ++k) {
      const std::string& s = k == 0 ? entries[i].first : entries[i].second;
      put32(b, 28 + 8 * (n * k + i), static_cast<uint32_t>(s.size()), big);
      put32(b, 32 + 8 * (n * k + i), static_cast<uint32_t>(b.size()), big);
      b.insert(b.end(), s.c_str(), s.c_str() + s.size() + 1);
    }
  return b;
}

std::string lookup(const std::vector<uint8_t>& image, const char* key) {
  int reason = -1;
  msgMoCatalog* c = msgMoParse(image.data(), image.size(), &reason);
  if (c == nullptr) return "<damaged " + std::to_string(reason) + ">";
  size_t len = 0;
  const char* t = msgMoLookup(c, key, &len);
  std::string text = t != nullptr ? std::string(t, len) : "<none>";
  msgMoFree(c);
  return text;
}
// The reason of a failed catalogue call: three characters after the ':'.
int reasonOf(const std::string& text) { return atoi(text.c_str() + text.find(':') + 3); }

// In either byte order only a decimal message number finds a text, and only
// a text that begins with its own id; the first of two wins.
TEST(MoReader, OnlyDecimalIdsWithTheirOwnTextsAreFound) {
  Entries entries = {
      {"", "KLP0000E header"},      {"0500", "KLP0500E leading zero"}, {"abc", "KLP0500E letters"},
      {"500", "KLP0500E first"},    {"500", "KLP0500E second"},        {"501", "KLP0500E misfiled"},
      {"502", "KLP0502X severity"}, {"503", "KLP0503"},                {"504", "hello"},
      {"12345", "KLP2345E five"},   {"7", "KLP0007W seven"},           {"9999", "KLP9999D last"}};
  const std::pair<const char*, const char*> rows[] = {
      {"500", "KLP0500E first"}, {"7", "KLP0007W seven"}, {"9999", "KLP9999D last"},
      {"", "<none>"},   {"0", "<none>"},   {"0500", "<none>"},  {"abc", "<none>"}, {"501", "<none>"},
      {"502", "<none>"}, {"503", "<none>"}, {"504", "<none>"}, {"12345", "<none>"},
      {"2345", "<none>"}, {"-1", "<none>"}};
  for (bool big : {false, true})
    for (const auto& [key, want] : rows) EXPECT_EQ(want, lookup(moImage(entries, big), key)) << key;
}

TEST(MoReader, DamagedImagesAreRefusedWithoutReadingOutside) {
  auto good = moImage({{"500", "KLP0500E first"}, {"501", "KLP0501E second"}});
  EXPECT_EQ("KLP0501E second", lookup(good, "501"));
  for (size_t cut = 0; cut < good.size(); ++cut)
    EXPECT_EQ("<damaged 3>", lookup({good.begin(), good.begin() + cut}, "500")) << cut;
  const struct { const char* what; size_t at; uint32_t value; } rows[] = {
      {"magic", 0, 0x12345678}, {"major revision", 4, 0x00010000}, {"count", 8, 0xFFFFFFFF},
      {"table offset beyond the file", 16, 0xFFFFFFF0},
      {"string offset wrapping in 32 bits", 28 + 8 + 4, 0xFFFFFFF8},
      {"string length beyond the file", 28 + 16, 0x7FFFFFFF}};
  for (const auto& r : rows) {
    auto bad = good;
    put32(bad, r.at, r.value);
    EXPECT_EQ("<damaged 3>", lookup(bad, "500")) << r.what;
  }
  // Far more entries than message numbers exist, every one sound: refused.
  EXPECT_EQ("<damaged 3>", lookup(moImage(Entries(70000)), "500"));
}

// The text with the values substituted, or why not: 2 missing, 3 unreadable or
// damaged, 4 no such message, 5 a bad call. Only a regular, whole file under
// the name in KLP_CATALOG_DIR is used; nothing there blocks.
TEST(Catalogue, TextsOrTheReasonWhyNot) {
  std::string image = klptest::readFile(kCatalog);
  char* values[4] = {const_cast<char*>("App"), const_cast<char*>("KLP\" : \"T"),
                     const_cast<char*>("PARM"), const_cast<char*>("")};
  auto misfiled = moImage({{"500", "KLP0501E filed under 500"}});
  auto file = [](std::string bytes) {
    return [bytes](const std::string& f) { return !(std::ofstream(f) << bytes).fail(); };
  };
  auto fifo = [](const std::string& f) { return mkfifo(f.c_str(), 0600) == 0; };
  auto dir = [](const std::string& f) { return mkdir(f.c_str(), 0700) == 0; };
  struct Row { std::function<bool(const std::string&)> make; int number, size; const char* want;
               std::string name = "vdbklp.mo"; } rows[] = {  // make: what stands under the name
      {file(image), 500, 200, "KLP0500E  \"App\" : \"KLP\" : \"T\" : The value \"PARM\" of the "
                              "parameter \"*\" is not valid."},
      {file(image), 500, 8, "KLP0500"},     {file(image), 4999, 200, "reason 4"},
      {fifo, 500, 200, "reason 3"},         {dir, 500, 200, "reason 3"},
      {file(image.substr(0, image.size() / 2)), 500, 200, "reason 3"},
      {file(std::string(misfiled.begin(), misfiled.end())), 500, 200, "reason 4"},
      {file(image), 500, 200, "reason 2", "/no/such/dir/vdbklp.mo"},
      {file(image), 500, 200, "reason 5", ""}};
  for (const auto& r : rows) {
    klptest::TmpDir tmp;
    ASSERT_TRUE(r.make(tmp.path() + "vdbklp.mo"));
    auto c = klptest::inChild(tmp.path(), [&] {
      setenv("KLP_CATALOG_DIR", tmp.path().c_str(), 1);
      msgCatalogReset();
      char text[220];
      memset(text, '#', sizeof text);
      int n = retrieveCatalogMsg(r.name.c_str(), r.number, nullptr, values, 4, text, r.size);
      printf("%s", n > 0 ? text : ("reason " + std::to_string(reasonOf(text))).c_str());
      int want = n > 0 ? static_cast<int>(strlen(text)) : -reasonOf(text);
      return text[r.size] == '#' && n == want ? 0 : 1;
    }, 10000);
    EXPECT_EQ(0, c.exitCode) << r.want;
    EXPECT_EQ(r.want, c.out);
  }
}

struct NamedCatalogLogger : msgLoggerU {
  explicit NamedCatalogLogger(const char* name) : msgLoggerU(MSG_APP_KLPKCCMD, 0) {
    snprintf(catalogName_, sizeof catalogName_, "%s", name);
  }
};
// Below 8000 the catalogue's text, else or without it the table's; without a
// catalogue KLP0513E once, to standard error and the log file. A blank thread
// name is the run-time thread's, cut to 15 characters.
TEST(Catalogue, LoggerUsesTheCatalogueAndFallsBack) {
  klptest::TmpDir tmp;
  auto c = klptest::inChild(tmp.path(), [&] {
    msgSetThreadNameProvider([]() -> const char* { return "a-very-long-thread-name"; });
    for (const char* catalog : {"vdbklp.mo", "no-such-catalogue.mo"}) {
      NamedCatalogLogger l(catalog);
      l.loadBuiltinMsgs(builtinMsgTable);
      l.setProgramQualifier("KLP");
      l.setLogFileName(tmp.path().c_str(), "test.log");
      for (int number : {506, 661}) l.putKlpMsg(number, MSG_DEST_STDOUT, "o", " ", "Capture Commands");
    }
    return 0;
  });
  std::string head = "  \"KlpKCcmd\" : \"KLP\" : \"a-very-long-thr\" : ";
  const std::string want[] = {
      "KLP0506E" + head + "The program could not reach the \"Capture Commands\" queue of the "
      "server. The server is not running or its queue is not available.",
      "KLP0661E Job was cancelled",
      "KLP0553W" + head + "An internal error  \"4\" occurred for message number \"506\"",
      "KLP0661E Job was cancelled"};
  auto out = klptest::lines(c.out);
  ASSERT_EQ(std::size(want), out.size()) << c.out;
  for (size_t i = 0; i < out.size(); ++i) EXPECT_EQ(27u, out[i].find(want[i])) << out[i];
  EXPECT_EQ(27u, c.err.find("KLP0513E \"KlpKCcmd\":\"KLP\" : \" \": The program could not open the "
                            "message file named 'no-such-catalogue.mo', Reason: CATALOG:  2")) << c.err;
  EXPECT_EQ(1u, klptest::lines(c.err).size());
  // Time stamp, origin, then the record's text with its own stamp.
  std::string log = klptest::readFile(tmp.path() + "test.log");
  EXPECT_EQ(27u + 16u + 27u, log.find("KLP0513E")) << log;
  EXPECT_EQ(27u, log.find("<composeKlpMsg> ")) << log;
}

}  // namespace

// Every number the programs issue has a text in the built catalogue that
// begins with its id and severity, and whose markers all get substituted
// (they must stand in ascending order). The status labels 7112-7124 and
// 7193 have no header values: the report cuts their first ten characters.
TEST(Catalogue, BuiltFileHoldsEveryIssuedNumber) {
  const int issued[] = {500, 501, 502, 503, 504, 506, 507, 508, 509, 510, 511, 513, 514, 517,
                        518, 519, 520, 521, 522, 523, 524, 525, 526, 527, 529, 534, 541, 543,
                        545, 552, 554, 568, 569, 574, 575, 589, 590, 591, 592, 593, 594, 595,
                        596, 597, 598, 599, 600, 601, 602, 606, 615, 616, 617, 619, 624, 626,
                        7112, 7113, 7114, 7115, 7116, 7117, 7118, 7119, 7120, 7121, 7122, 7123,
                        7124, 7193};
  char v[9][3] = {"v1", "v2", "v3", "v4", "v5", "v6", "v7", "v8", "v9"};
  char* values[9] = {v[0], v[1], v[2], v[3], v[4], v[5], v[6], v[7], v[8]};
  for (int number : issued) {
    char text[1100], id[8];
    snprintf(id, sizeof id, "KLP%04d", number);
    ASSERT_GT(retrieveCatalogMsg(kCatalog.c_str(), number, nullptr, values, 9, text, sizeof text),
              0) << number;
    EXPECT_EQ(0, strncmp(text, id, 7)) << text;
    EXPECT_NE(nullptr, strchr("EIW", text[7])) << text;
    bool label = number >= 7112;
    EXPECT_EQ(0, strncmp(text + 8, label ? "  " : "  \"v1\" : \"v2\" : ", label ? 2 : 16)) << text;
    for (const char* p = text; (p = strchr(p, '$')) != nullptr; ++p)
      EXPECT_FALSE(p[1] >= '1' && p[1] <= '9') << "unsubstituted marker in " << text;
  }
}

// A program finds the catalogue beside itself or through KLP_CATALOG_DIR,
// never in the build tree it was built in: a copy elsewhere has none.
TEST(Catalogue, ProgramsLookBesideThemselvesNotInTheBuildTree) {
  klptest::TmpDir tmp;
  std::string built = klptest::binPath("klpkccmd"), copy = tmp.path() + "klpkccmd";
  ASSERT_EQ(0, klptest::run({"/bin/cp", built, copy}).exitCode);
  const struct { std::string program; std::vector<std::string> env; bool found; } rows[] = {
      {built, {}, true}, {copy, {}, false}, {copy, {"KLP_CATALOG_DIR=" KLP_BIN_DIR}, true}};
  for (const auto& r : rows) {
    auto p = klptest::run({r.program}, r.env);
    EXPECT_EQ(12, p.exitCode);
    EXPECT_EQ(r.found, p.err.find("KLP0513E") == std::string::npos) << r.program << p.err;
  }
}
