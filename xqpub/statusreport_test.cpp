// The labelled status reports, line by line.
#include "xqpub/statusreport.h"

#include <gtest/gtest.h>

#include <cstring>
#include <string>

#include "include/klpapi.h"
#include "tests/testing/klptest.h"

namespace {

klpStatusFmt3 sampleStatus() {
  klpStatusFmt3 s{};
  s.format = 3, s.upTime = 90061, s.activeSubs = 12, s.currentMemory = 65536;
  std::strcpy(s.logFile, "/var/log/kcap.log");
  std::strcpy(s.currentLogTime, "2024-05-06-07.08.09.000010");
  std::strcpy(s.allPublishedLsn, "00000000ABCDEF01");
  return s;
}

// The full, short and not-available reports, one after the other; the other
// two never read the status data; the quiet flag silences all three; a
// value ends after 3000 characters.
TEST(StatusReport, TheThreeReportsAndTheQuietFlag) {
  klpReportRow row[1] = {{0, "L", "K", std::string(5000, 'v')}};
  std::string line;
  klpFormatReport(row, 1, 0, &line);
  EXPECT_EQ(line, "L (K) = " + std::string(3000, 'v'));
  klptest::ProcessLogger logger;
  auto s = sampleStatus();
  EXPECT_EQ(klptest::stdoutOf([&] {
              klpPrintFullStatus("MYDB", "KLP", &s, 0);
              klpPrintShortStatus("MYDB", "KLP", nullptr, 0);
              klpPrintNotAvailableStatus("MYDB", "KLP", nullptr, 0);
              klpPrintFullStatus("MYDB", "KLP", &s, 1);
              klpPrintShortStatus("MYDB", "KLP", nullptr, 1);
              klpPrintNotAvailableStatus("MYDB", "KLP", nullptr, 1);
            }),
            klptest::readFile(KLP_SOURCE_DIR "/xqpub/statusreports.golden"));
}

}  // namespace
