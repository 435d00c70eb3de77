// The labelled status reports: exact line layout, the three variants and
// the values taken from the status data.
#include "xqpub/statusreport.h"

#include <gtest/gtest.h>

#include <cstring>
#include <sstream>
#include <string>
#include <vector>

#include "common/msg/klplog.h"
#include "common/msg/msglogger.h"
#include "include/klpapi.h"

namespace {

std::vector<std::string> splitLines(const std::string& text) {
  std::vector<std::string> lines;
  std::istringstream in(text);
  for (std::string l; std::getline(in, l);) lines.push_back(l);
  return lines;
}

// Reports print catalogue texts: they need the process logger.
class StatusReport : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    saved_ = klpGetProcessLogger();
    logger_ = createMsgLoggerU(MSG_APP_KLPKCCMD, 0);
    ASSERT_NE(logger_, nullptr);
    logger_->loadBuiltinMsgs(builtinMsgTable);
    klpSetProcessLogger(logger_);
  }
  static void TearDownTestSuite() {
    klpSetProcessLogger(saved_);
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

  static msgLogger* logger_;
  static msgLogger* saved_;
};
msgLogger* StatusReport::logger_ = nullptr;
msgLogger* StatusReport::saved_ = nullptr;

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

TEST(StatusReportLayout, ColumnsFollowTheWidestRow) {
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
  for (const auto& l : lines) EXPECT_EQ(l.substr(23, 4), ") = ") << l;
}

TEST(StatusReportLayout, ValueIsBoundedTo3000Characters) {
  klpReportRow rows[1] = {{0, "L", "K", std::string(5000, 'v')}};
  std::string lines[1];
  klpFormatReport(rows, 1, 2, lines);
  EXPECT_EQ(lines[0].size(), 2u + 1 + 1 + 6 + 3000);
}

TEST_F(StatusReport, LabelsLoseTheirMessageId) {
  EXPECT_EQ(klpCatalogLabel(7112), "Server name");
  std::string heading = klpCatalogLabel(7122);
  EXPECT_FALSE(heading.empty());
  EXPECT_EQ(heading.find("KLP7122"), std::string::npos);
}

TEST_F(StatusReport, FullReportPrintsNineAlignedRows) {
  auto s = sampleStatus("/var/log/kcap.log");
  testing::internal::CaptureStdout();
  klpPrintFullStatus("MYDB", "KLP", &s, 0);
  auto lines = splitLines(testing::internal::GetCapturedStdout());
  ASSERT_EQ(lines.size(), 10u);
  EXPECT_EQ(lines[0], klpCatalogLabel(7122));

  struct Want {
    int msg;
    const char* keyword;
    std::string value;
  } want[9] = {
      {7112, "SERVER", "MYDB"},
      {7113, "SCHEMA", "KLP"},
      {7114, "STATUS", klpCatalogLabel(7123)},
      {7115, "UP_TIME", "  1d  1h  1m  1s"},
      {7116, "LOGFILE", "/var/log/kcap.log"},
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
  EXPECT_NE(lines[9].find("(CURRENT_MEMORY ) = "), std::string::npos);
}

TEST_F(StatusReport, LongLogFileKeepsTheColumn) {
  auto shortOne = sampleStatus("/l");
  auto longOne = sampleStatus(std::string(900, 'f'));
  testing::internal::CaptureStdout();
  klpPrintFullStatus("MYDB", "KLP", &shortOne, 0);
  auto a = splitLines(testing::internal::GetCapturedStdout());
  testing::internal::CaptureStdout();
  klpPrintFullStatus("MYDB", "KLP", &longOne, 0);
  auto b = splitLines(testing::internal::GetCapturedStdout());
  ASSERT_EQ(a.size(), 10u);
  ASSERT_EQ(b.size(), 10u);
  size_t col = a[1].find(" = ");
  for (int i = 1; i < 10; ++i) {
    EXPECT_EQ(a[i].find(" = "), col) << a[i];
    EXPECT_EQ(b[i].find(" = "), col) << b[i];
  }
  EXPECT_EQ(b[5].size(), col + 3 + 900);
}

TEST_F(StatusReport, ShortReportNeedsNoStatusData) {
  testing::internal::CaptureStdout();
  klpPrintShortStatus("MYDB", "KLP", nullptr, 0);
  auto lines = splitLines(testing::internal::GetCapturedStdout());
  ASSERT_EQ(lines.size(), 4u);
  size_t width = 0;
  for (int m : {7112, 7113, 7114})
    width = std::max(width, 2 + klpCatalogLabel(m).size() + 6 + 6);
  EXPECT_EQ(lines[1], expectedLine(klpCatalogLabel(7112), "SERVER", "MYDB", width));
  EXPECT_EQ(lines[3], expectedLine(klpCatalogLabel(7114), "STATUS", klpCatalogLabel(7124), width));
}

TEST_F(StatusReport, NotAvailableReportUses7193TwiceOnTheStatusRow) {
  testing::internal::CaptureStdout();
  klpPrintNotAvailableStatus("MYDB", "KLP", nullptr, 0);
  auto lines = splitLines(testing::internal::GetCapturedStdout());
  ASSERT_EQ(lines.size(), 4u);
  std::string na = klpCatalogLabel(7193);
  ASSERT_FALSE(na.empty());
  EXPECT_EQ(lines[3].find("  " + na), 0u) << lines[3];
  EXPECT_EQ(lines[3].substr(lines[3].size() - na.size() - 3), " = " + na);
}

TEST_F(StatusReport, QuietFlagPrintsNothing) {
  auto s = sampleStatus("/l");
  testing::internal::CaptureStdout();
  klpPrintFullStatus("MYDB", "KLP", &s, 1);
  klpPrintShortStatus("MYDB", "KLP", nullptr, 1);
  klpPrintNotAvailableStatus("MYDB", "KLP", nullptr, 1);
  EXPECT_EQ(testing::internal::GetCapturedStdout(), "");
}

}  // namespace
