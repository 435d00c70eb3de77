// The labelled status reports against a golden file; the other two never read the status data.
#include "xqpub/statusreport.h"

#include <gtest/gtest.h>

#include <cstring>
#include <string>

#include "include/klpapi.h"
#include "tests/testing/klptest.h"

namespace {

// Full, short and not-available reports, then all three quiet; a value ends after 3000 characters.
TEST(StatusReport, TheThreeReportsAndTheQuietFlag) {
  klpReportRow row[1] = {{0, "L", "K", std::string(5000, 'v')}};
  std::string line;
  klpFormatReport(row, 1, 0, &line);
  EXPECT_EQ(line, "L (K) = " + std::string(3000, 'v'));
  klptest::ProcessLogger logger;
  klpStatusFmt3 s{};
  s.format = 3, s.upTime = 90061, s.activeSubs = 12, s.currentMemory = 65536;
  std::strcpy(s.logFile, "/var/log/kcap.log");
  std::strcpy(s.currentLogTime, "2024-05-06-07.08.09.000010");
  std::strcpy(s.allPublishedLsn, "00000000ABCDEF01");
  EXPECT_EQ(klptest::stdoutOf([&] {
              for (int quiet : {0, 1}) {
                klpPrintFullStatus("MYDB", "KLP", &s, quiet);
                klpPrintShortStatus("MYDB", "KLP", nullptr, quiet);
                klpPrintNotAvailableStatus("MYDB", "KLP", nullptr, quiet);
              }
            }),
            klptest::readFile(KLP_SOURCE_DIR "/xqpub/statusreports.golden"));
}

}  // namespace
