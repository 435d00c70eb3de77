// Run-time library loading: candidates that are no library or absent, a driver missing
// functions, and the OCI wrappers over stand-in client libraries.
#include "common/db/klpdll.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <functional>
#include <string>

#include "common/db/oradl.h"
#include "common/msg/msglogger.h"
#include "tests/testing/klptest.h"

namespace {

const std::string kTextFile = std::string(KLP_SOURCE_DIR) + "/tests/db/notalib.so";
const std::string kDriver = std::string(KLP_TESTLIB_DIR) + "/libklptest_odbc.so";

size_t count(const std::string& text, const std::string& what) {
  size_t n = 0;
  for (size_t at = text.find(what); at != std::string::npos; at = text.find(what, at + 1)) ++n;
  return n;
}

}  // namespace

TEST(KlpDll, CandidatesLoadOnceAndFailuresReportOnce) {
  klptest::TmpDir dir;
  klptest::ProcessLogger logger(MSG_APP_KLPKCCMD, dir.path(), "dll.log");
  auto log = [&] { return klptest::readFile(dir.path() + "dll.log"); };

  const klpDLLCandidate loads[] = {{kTextFile.c_str(), "A"}, {kDriver.c_str(), "A"}};
  klpDLLFunc funcs[] = {{"SQLAllocHandle", nullptr}, {"SQLCancel", KLPDLL_OPTIONAL},
                        {"SQLDisconnect", nullptr}, {"SQLConnect", nullptr}};
  klpDLL good("ODB_DLL", loads, 2, funcs, 4);
  EXPECT_EQ(klpdll::loadLib(&good), 0);
  EXPECT_EQ(good.state, 1);  // the second candidate
  auto alloc = reinterpret_cast<int (*)(int)>(funcs[0].slot);
  ASSERT_NE(alloc, nullptr);
  EXPECT_EQ(alloc(41), 42);
  EXPECT_EQ(funcs[1].slot, nullptr);
  EXPECT_EQ(funcs[2].slot, nullptr);
  EXPECT_NE(funcs[3].slot, nullptr);
  EXPECT_EQ(klpdll::loadLib(&good), 0);  // optional stays optional
  std::string text = log();
  EXPECT_NE(text.find("KLP0606I") , std::string::npos) << text;
  EXPECT_NE(text.find(kDriver), std::string::npos);
  EXPECT_EQ(count(text, "KLP0617E"), 2u) << text;  // once per resolve
  EXPECT_EQ(text.find("SQLCancelA"), std::string::npos) << text;
  EXPECT_NE(text.find("\"SQLDisconnectA\" was not found"), std::string::npos) << text;
  EXPECT_EQ(text.find("KLP0616E"), std::string::npos);
  klpdll::reportLibs(&good, "test::report", "Driver libraries.");
  EXPECT_NE(log().find(kTextFile + ", " + kDriver), std::string::npos);

  const klpDLLCandidate none[] = {{kTextFile.c_str(), ""}, {"/nonexistent/libklp.so", ""}};
  klpDLL bad("ODB_DLL", none, 2, funcs, 4);
  EXPECT_EQ(klpdll::loadLib(&bad), KLPDLL_RC_NOT_LOADED);
  EXPECT_EQ(bad.state, KLPDLL_NOT_LOADED | KLPDLL_FAILURE_REPORTED);
  EXPECT_EQ(klpdll::loadLib(&bad), 0);  // silent, still not loaded
  EXPECT_EQ(bad.state, KLPDLL_NOT_LOADED | KLPDLL_FAILURE_REPORTED | KLPDLL_FAILURE_SEEN_AGAIN);
  text = log();
  EXPECT_EQ(count(text, "KLP0616E"), 1u) << text;
  EXPECT_NE(text.find("\"ENOEXEC,2\""), std::string::npos) << text;
  EXPECT_NE(text.find("HSVe return code 0x90000002 with description"), std::string::npos);
}

TEST(OraDl, WrappersOverStandInClientLibraries) {
  const std::string full = std::string(KLP_TESTLIB_DIR) + "/full/libclntsh.so";
  const std::string partial = std::string(KLP_TESTLIB_DIR) + "/nolobread2/libclntsh.so";
  struct Row {
    const char* what;
    std::function<int()> body;  // 0 when every call answered as expected
    std::vector<std::pair<std::string, size_t>> logged;  // text, times
  };
  klptest::TmpDir later;
  const std::string appears = later.path() + "libclntsh.so";
  const Row rows[] = {
      {"all 39 functions",
       [&] {
         ORADL::setLibraryName(full.c_str());
         int x = 0;
         oraub8 len = 0;
         bool ok = ORADL::OCIInit() == 1 && ORADL::OCIHandleFree(&x, 5) == 5 &&
                   ORADL::OCITerminate(21) == 42 &&
                   ORADL::OCILobGetLength2(nullptr, nullptr, nullptr, &len) == 0 &&
                   len == 123456789012ull &&
                   ORADL::OCILobLocatorIsInit(nullptr, nullptr, nullptr, nullptr) == 39;
         return ok ? 0 : 1;
       },
       {{"KLP0658I", 1}, {"KLP0659E", 0}, {"KLP0660E", 0}}},
      {"OCILobRead2 missing: it and every later function answer -2",
       [&] {
         ORADL::setLibraryName(partial.c_str());
         bool ok = ORADL::OCIInit() == 0 &&
                   ORADL::OCILobWrite2(nullptr, nullptr, nullptr, nullptr, nullptr, 0, nullptr, 0,
                                       0, nullptr, nullptr, 0, 0) == 32 &&
                   ORADL::OCILobRead2(nullptr, nullptr, nullptr, nullptr, nullptr, 0, nullptr, 0,
                                      0, nullptr, nullptr, 0, 0) == -2 &&
                   ORADL::OCIStmtRelease(nullptr, nullptr, nullptr, 0, 0) == -2;
         return ok ? 0 : 1;
       },
       {{"KLP0658I", 1},
        {"address for \"OCILobRead2\"", 4},
        {"<ORADL:OCILobRead2>", 1},
        {"<ORADL:OCIStmtRelease>", 1}}},
      {"library absent, then present",
       [&] {
         ORADL::setLibraryName(appears.c_str());
         if (ORADL::OCITerminate(3) != -2) return 1;
         std::filesystem::copy_file(full, appears);
         return ORADL::OCITerminate(3) == 6 ? 0 : 2;
       },
       {{"KLP0657E", 1}, {"<ORADL:OCITerminate>", 1}, {"KLP0658I", 1}}},
      {"quiet",
       [&] {
         ORADL::setQuiet(1);
         ORADL::setLibraryName("/nonexistent/libclntsh.so");
         return ORADL::OCIHandleFree(nullptr, 0) == -2 ? 0 : 1;
       },
       {{"KLP06", 0}}},
  };
  for (const Row& r : rows) {  // each in a child: the OCI state is process-wide
    klptest::TmpDir dir;
    auto c = klptest::inChild(dir.path(), [&] {
      klptest::ProcessLogger logger(MSG_APP_KLPKCCMD, dir.path(), "oci.log");
      return r.body();
    });
    const std::string log = klptest::readFile(dir.path() + "oci.log");
    EXPECT_EQ(c.exitCode, 0) << r.what << "\n" << c.out << c.err;
    for (const auto& [text, times] : r.logged)
      EXPECT_EQ(count(log, text), times) << r.what << ": " << text << "\n" << log;
  }
}
