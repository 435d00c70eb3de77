// The labelled status reports: exact line layout, the three variants and
// the values taken from the status data.
#include "xqpub/statusreport.h"

#include <gtest/gtest.h>

#include <cstring>
#include <functional>
#include <sstream>
#include <string>
#include <vector>

#include "common/msg/klplog.h"
#include "common/msg/msglogger.h"
#include "include/klpapi.h"
#include "tests/testing/klptest.h"

namespace {

// The lines printed to stdout by `print`.
std::vector<std::string> printed(const std::function<void()>& print) {
  testing::internal::CaptureStdout();
  print();
  std::vector<std::string> lines;
  std::istringstream in(testing::internal::GetCapturedStdout());
  for (std::string l; std::getline(in, l);) lines.push_back(l);
  return lines;
}

// Reports print catalogue texts: they need the process logger.
class StatusReport : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    logger_ = new klptest::ProcessLogger;
  }
  static void TearDownTestSuite() {
    delete logger_;
  }

  // The line a row must print as in a report whose widest row is `width`.
  static std::string expectedLine(const std::string& label, const std::string& keyword,
                                  const std::string& value, size_t width) {
    std::string line = "  " + label;
    std::string kw = "(" + keyword + ")";
    line += std::string(width - 3 - kw.size() - line.size(), ' ');
    return line + kw + " = " + value;
  }

  static klptest::ProcessLogger* logger_;
};
klptest::ProcessLogger* StatusReport::logger_ = nullptr;

klpStatusFmt3 sampleStatus(const std::string& logFile) {
  klpStatusFmt3 s;
  std::memset(&s, 0, sizeof(s));
  s.format = 3;
  s.upTime = 90061;
  std::snprintf(s.logFile, sizeof(s.logFile), "%s", logFile.c_str());
  s.activeSubs = 12;
  std::snprintf(s.currentLogTime, sizeof(s.currentLogTime), "2024-05-06-07.08.09.000010");
  std::snprintf(s.allPublishedLsn, sizeof(s.allPublishedLsn), "00000000ABCDEF01");
  s.currentMemory = 65536;
  return s;
}

TEST(StatusReportLayout, ColumnsFollowTheWidestRowAndValuesAreBounded) {
  klpReportRow rows[3] = {
      {0, "Ab", "K", "x"},
      {0, "Longer label", "KEYWORD", "value"},
      {0, "Mid", "TRAIL ", ""},
  };
  std::string lines[3];
  klpFormatReport(rows, 3, 2, lines);
  // W = 2 + (12 + 7 + 6) = 27: the widest label has one blank before "(".
  EXPECT_EQ(lines[1], "  Longer label (KEYWORD) = value");
  EXPECT_EQ(lines[0], "  Ab" + std::string(17, ' ') + "(K) = x");
  EXPECT_EQ(lines[2], "  Mid" + std::string(11, ' ') + "(TRAIL ) = ");

  klpReportRow big[1] = {{0, "L", "K", std::string(5000, 'v')}};
  klpFormatReport(big, 1, 2, lines);
  EXPECT_EQ(lines[0].size(), 2u + 1 + 1 + 6 + 3000);
}

// Labels lose their message id; a long log file keeps the column.
TEST_F(StatusReport, FullReportPrintsNineAlignedRows) {
  EXPECT_EQ(klpCatalogLabel(7112), "Server name");
  std::string heading = klpCatalogLabel(7122);
  EXPECT_FALSE(heading.empty());
  EXPECT_EQ(heading.find("KLP7122"), std::string::npos);

  for (const std::string& logFile : {std::string("/var/log/kcap.log"), std::string(900, 'f')}) {
    auto s = sampleStatus(logFile);
    auto lines = printed([&] { klpPrintFullStatus("MYDB", "KLP", &s, 0); });
    ASSERT_EQ(lines.size(), 10u);
    EXPECT_EQ(lines[0], heading);
    const struct {
      int msg;
      const char* keyword;
      std::string value;
    } want[9] = {
        {7112, "SERVER", "MYDB"},
        {7113, "SCHEMA", "KLP"},
        {7114, "STATUS", klpCatalogLabel(7123)},
        {7115, "UP_TIME", "  1d  1h  1m  1s"},
        {7116, "LOGFILE", logFile},
        {7117, "ACTIVE_KSUBS", "12"},
        {7119, "CURRENT_LOG_TIME", "2024-05-06-07.08.09.000010"},
        {7120, "ALL_PUBLISHED_AS_OF_LSN", "00000000ABCDEF01"},
        {7121, "CURRENT_MEMORY ", "65536 bytes"},
    };
    size_t width = 0;
    for (const auto& w : want)
      width = std::max(width, 2 + klpCatalogLabel(w.msg).size() + std::strlen(w.keyword) + 6);
    for (int i = 0; i < 9; ++i)
      EXPECT_EQ(lines[i + 1], expectedLine(klpCatalogLabel(want[i].msg), want[i].keyword,
                                           want[i].value, width));
  }
}

// The short and the not-available reports need no status data; the quiet
// flag silences all three.
TEST_F(StatusReport, ShortNotAvailableAndQuietReports) {
  auto lines = printed([] { klpPrintShortStatus("MYDB", "KLP", nullptr, 0); });
  ASSERT_EQ(lines.size(), 4u);
  size_t width = 0;
  for (int m : {7112, 7113, 7114})
    width = std::max(width, 2 + klpCatalogLabel(m).size() + 6 + 6);
  EXPECT_EQ(lines[1], expectedLine(klpCatalogLabel(7112), "SERVER", "MYDB", width));
  EXPECT_EQ(lines[3], expectedLine(klpCatalogLabel(7114), "STATUS", klpCatalogLabel(7124), width));

  // Message 7193 is used twice on the status row.
  lines = printed([] { klpPrintNotAvailableStatus("MYDB", "KLP", nullptr, 0); });
  ASSERT_EQ(lines.size(), 4u);
  std::string na = klpCatalogLabel(7193);
  ASSERT_FALSE(na.empty());
  EXPECT_EQ(lines[3].find("  " + na), 0u) << lines[3];
  EXPECT_EQ(lines[3].substr(lines[3].size() - na.size() - 3), " = " + na);

  auto s = sampleStatus("/l");
  EXPECT_TRUE(printed([&] {
                klpPrintFullStatus("MYDB", "KLP", &s, 1);
                klpPrintShortStatus("MYDB", "KLP", nullptr, 1);
                klpPrintNotAvailableStatus("MYDB", "KLP", nullptr, 1);
              }).empty());
}

}  // namespace
