// The logger's destinations: routing, the exact console and log-file lines,
// log-file failures, stop/restart, the process-wide issuing functions and
// the generated definitions header. Output is captured in child processes.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <atomic>
#include <cstring>
#include <regex>
#include <string>
#include <thread>

#include "common/msg/msglogger.h"
#include "tests/testing/klptest.h"

namespace {

const char* kStamp = "\\d{4}-\\d\\d-\\d\\d-\\d\\d\\.\\d\\d\\.\\d\\d\\.\\d{6}";

// The line is a time stamp, a blank and then the pattern.
bool stamped(const std::string& line, const std::string& pattern) {
  return std::regex_match(line, std::regex(std::string(kStamp) + " " + pattern));
}

using klptest::lines;

struct LoggerTest : ::testing::Test {
  klptest::TmpDir tmp;
  std::string logPath() const { return tmp.path() + "test.log"; }
  std::string log() const { return klptest::readFile(logPath()); }
  klptest::Child inChild(const std::function<int()>& body) { return klptest::inChild(tmp.path(), body); }
  // Builtin table, optionally the "KLP" qualifier and the log file test.log.
  void prepare(msgLogger& l, bool qualifier = true, bool logFile = true) {
    l.loadBuiltinMsgs(builtinMsgTable);
    if (qualifier) l.setProgramQualifier("KLP");
    if (logFile) l.setLogFileName(tmp.path().c_str(), "test.log");
  }
};

// A logger whose catalogue hands out fixed texts, to drive the severity and
// routing rules with texts the table does not have.
struct FixedTextLogger : msgLogger {
  const char* fixed;
  explicit FixedTextLogger(const char* text) : msgLogger(MSG_APP_KLPKCCMD, 0), fixed(text) {}
  int getCatalogMsg(int, int size, char* text) override {
    snprintf(text, static_cast<size_t>(size) + 1, "%s", fixed);
    return 1;
  }
};

TEST_F(LoggerTest, RoutingBySeverityAndConsoleFlagAndLineFormats) {
  auto c = inChild([&] {
    FixedTextLogger error("KLP0700E error text");
    error.setLogFileName(tmp.path().c_str(), "test.log");
    FixedTextLogger info("KLP0700I info text");
    info.setLogFileName(tmp.path().c_str(), "test.log");
    error.putKlpMsg(700, MSG_ROUTE_BY_SEVERITY, "o", "t");  // file and console
    info.putKlpMsg(700, MSG_ROUTE_BY_SEVERITY, "o", "t");   // file only
    info.setConsoleFlag(1);
    info.putKlpMsg(700, MSG_ROUTE_BY_SEVERITY, "o", "t");   // file and console
    info.setConsoleFlag(0);
    info.putKlpMsg(700, MSG_DEST_STDOUT_IF, "o", "t");      // nothing at all
    info.putKlpMsg(700, MSG_DEST_STDOUT, "o", "t");         // console only
    // Origin and thread name cut to 30 and 15 characters.
    msgLogger l(MSG_APP_KLPKCCMD, 0);
    prepare(l);
    l.putKlpMsg(8006, MSG_DEST_LOGFILE, "0123456789012345678901234567890123456789",
                "01234567890123456789", "X");
    return 0;
  });
  ASSERT_TRUE(c.exited);
  auto out = lines(c.out);
  ASSERT_EQ(3u, out.size()) << c.out;
  EXPECT_TRUE(stamped(out[0], "KLP0700E error text")) << out[0];
  EXPECT_TRUE(stamped(out[1], "KLP0700I info text")) << out[1];
  EXPECT_TRUE(stamped(out[2], "KLP0700I info text")) << out[2];
  EXPECT_EQ("", c.err);
  std::string text = log();
  ASSERT_FALSE(text.empty());
  EXPECT_EQ('\n', text.back());
  auto file = lines(text);
  ASSERT_EQ(4u, file.size()) << text;
  EXPECT_TRUE(stamped(file[0], "<o> KLP0700E error text")) << file[0];
  EXPECT_TRUE(stamped(file[3], "<012345678901234567890123456789> KLP8006D  \"KlpKCcmd\" : "
                               "\"KLP\" : \"012345678901234\" : Element \"X\" is out of range\\."))
      << file[3];
}

TEST_F(LoggerTest, SeverityIsReadBackFromTheText) {
  // Text given, text shown (a lower-case severity letter shown upper case).
  for (auto [text, shown] : {std::pair{"KLP0700w lower", "KLP0700W lower"},
                             {"KLP0700i lower", "KLP0700I lower"},
                             {"KLP0700X odd", "KLP0700X odd"},
                             {"no id at all", "no id at all"},
                             {"prefix KLP0700E later", "prefix KLP0700E later"},
                             {"KLP0701E another id", "KLP0701E another id"}}) {
    FixedTextLogger l(text);
    char buf[128];
    l.getKlpMsgText(700, "o", "t", buf, sizeof buf);
    EXPECT_STREQ(shown, buf);
  }
  // Blank severity routes by the "other" word: with it set to console
  // only, such a text shows on standard output.
  auto c = inChild([&] {
    FixedTextLogger noId("no id at all");
    noId.setRoutingWord(' ', MSG_DEST_STDOUT);
    noId.putKlpMsg(700, MSG_ROUTE_BY_SEVERITY, "o", "t");
    FixedTextLogger lower("KLP0700w lower");
    lower.setRoutingWord('W', MSG_DEST_STDOUT);  // found only as upper case 'W'
    lower.putKlpMsg(700, MSG_ROUTE_BY_SEVERITY, "o", "t");
    return 0;
  });
  auto out = lines(c.out);
  ASSERT_EQ(2u, out.size()) << c.out;
  EXPECT_NE(std::string::npos, out[0].find(" no id at all"));
  EXPECT_NE(std::string::npos, out[1].find(" KLP0700W lower"));
}

TEST_F(LoggerTest, NoLogFileNameWritesNothingAndOpenFailureIsReportedOncePerStreak) {
  auto c = inChild([&] {
    msgLogger l(MSG_APP_KLPKCCMD, 0);
    prepare(l, true, false);
    if (l.putKlpMsg(8999, MSG_DEST_LOGFILE, "o", "t", "nowhere") != 0) return 1;
    std::string bad = tmp.path() + "missing-dir";
    l.setLogFileName(bad.c_str(), "x.log");
    l.putKlpMsg(8999, MSG_DEST_LOGFILE, "o", "t", "lost 1");
    l.putKlpMsg(8999, MSG_DEST_LOGFILE, "o", "t", "lost 2");
    l.setLogFileName(tmp.path().c_str(), "test.log");
    l.putKlpMsg(8999, MSG_DEST_LOGFILE, "o", "t", "written");
    l.setLogFileName(bad.c_str(), "x.log");
    l.putKlpMsg(8999, MSG_DEST_LOGFILE, "o", "t", "lost 3");
    return 0;
  });
  ASSERT_TRUE(c.exited);
  EXPECT_EQ(0, c.exitCode);
  EXPECT_EQ("", c.out);
  auto err = lines(c.err);
  ASSERT_EQ(2u, err.size()) << c.err;
  std::string expected = "KLP0514E \"KlpKCcmd\" : \"KLP\" : \"Initial\" :  The program could "
                         "not open the log file named \"" +
                         tmp.path() + "missing-dir/x\\.log\", reason: \"No such file or directory\"";
  EXPECT_TRUE(stamped(err[0], expected)) << err[0];
  EXPECT_TRUE(stamped(err[1], expected)) << err[1];
  auto file = lines(log());
  ASSERT_EQ(1u, file.size());
  EXPECT_NE(std::string::npos, file[0].find("KLP8999D written"));
}

TEST_F(LoggerTest, LogFileIsNotKeptOpenBetweenLines) {
  msgLogger l(MSG_APP_KLPKCCMD, 0);
  prepare(l, false);
  l.putKlpMsg(8999, MSG_DEST_LOGFILE, "o", "t", "one");
  // Moving the file away between lines: the next line starts a new file.
  ASSERT_EQ(0, rename(logPath().c_str(), (tmp.path() + "moved.log").c_str()));
  l.putKlpMsg(8999, MSG_DEST_LOGFILE, "o", "t", "two");
  EXPECT_NE(std::string::npos, klptest::readFile(tmp.path() + "moved.log").find("one"));
  EXPECT_EQ(std::string::npos, log().find("one"));
  EXPECT_NE(std::string::npos, log().find("two"));
  l.clearLog();
  EXPECT_EQ("", log());
  struct stat st;
  EXPECT_EQ(0, stat(logPath().c_str(), &st));
}

TEST_F(LoggerTest, LogFileNameJoining) {
  msgLogger l(1, 0);
  EXPECT_STREQ("/a/b/c.log", l.setLogFileName("/a/b", "c.log"));
  EXPECT_STREQ("/a/b/c.log", l.setLogFileName("/a/b/", "c.log"));
  EXPECT_STREQ("c.log", l.setLogFileName("", "c.log"));
  std::string longDir(1100, 'd');
  EXPECT_STREQ("", l.setLogFileName(longDir.c_str(), "c.log"));
  EXPECT_STREQ("S.T", l.setMsgTableName("S", "T"));
  std::string s(200, 's');
  EXPECT_EQ(128u + 1 + 1, strlen(l.setMsgTableName(s.c_str(), "T")));
}

TEST_F(LoggerTest, StopAndRestartLogging) {
  auto c = inChild([&] {
    msgLogger l(MSG_APP_KLPKCCMD, 0);
    prepare(l, false);
    l.stopLogging();
    l.putKlpMsg(8999, MSG_DEST_LOGFILE | MSG_DEST_STDOUT, "o", "t", "while stopped");
    l.restartLogging("restarter");
    l.putKlpMsg(8999, MSG_DEST_LOGFILE, "o", "t", "after");
    return 0;
  });
  ASSERT_TRUE(c.exited);
  EXPECT_NE(std::string::npos, c.out.find("KLP8999D while stopped"));  // console still served
  auto file = lines(log());
  ASSERT_EQ(2u, file.size()) << log();
  EXPECT_TRUE(stamped(file[0], "<restarter> KLP8999D Message logging re-enabled"))
      << file[0];
  EXPECT_NE(std::string::npos, file[1].find("KLP8999D after"));
}

TEST_F(LoggerTest, ProcessWideFunctions) {
  auto c = inChild([&] {
    msgLogger* l = new msgLogger(MSG_APP_KLPKCCMD, 0);
    prepare(*l);
    klpSetProcessLogger(l);
    logKlpMsg(-1, "free", KLP_DEST_CONSOLE, "just text", nullptr, 0);
    logKlpMsg(8006, "elem", KLP_DEST_LOG, "X", nullptr, 0);  // file only, console flag off
    l->setConsoleFlag(1);
    logKlpMsg(8005, "state", KLP_DEST_LOG, "thr", nullptr, 1, "7");
    l->setConsoleFlag(0);
    logInternalError("where", 801, "what", "the detail");
    klpSetProcessLogger(nullptr);
    delete l;
    return logKlpMsg(8999, "o", 1, "x", nullptr, 0) == 0 ? 1 : 0;  // no logger: refused
  });
  ASSERT_TRUE(c.exited);
  EXPECT_EQ(0, c.exitCode);
  auto out = lines(c.out);
  ASSERT_EQ(2u, out.size()) << c.out;
  EXPECT_TRUE(stamped(out[0], "KLP8999D just text")) << out[0];
  EXPECT_NE(std::string::npos,
            out[1].find("KLP8005D  \"KlpKCcmd\" : \"KLP\" : \"\" : Thread \"thr\" is in "
                        "un-expected state \"7\"."));
  std::string file = log();
  EXPECT_NE(std::string::npos, file.find("<elem> KLP8006D"));
  // The internal error: 589 (not in the table of the plain logger, so it
  // shows as 553 with its values) and then the detail at routing 8.
  EXPECT_NE(std::string::npos, file.find("<where> KLP0553W")) << file;
  EXPECT_NE(std::string::npos, file.find("\"where\", \"801\", \"what\"")) << file;
  EXPECT_NE(std::string::npos, file.find("<where> KLP8999D the detail")) << file;
  EXPECT_LT(file.find("KLP0553W"), file.find("the detail"));
  EXPECT_EQ(std::string::npos, c.out.find("the detail"));
}

TEST_F(LoggerTest, CaptureContextStaysInsideItsBuffer) {
  msgLogger l(MSG_APP_KLPKCCMD, 0);
  l.loadBuiltinMsgs(builtinMsgTable);
  klpSetProcessLogger(&l);
  char buf[2 + 16 + 8];
  memset(buf, '#', sizeof buf);
  klpMsgCtx ctx{1, 0, 0, 16, buf};
  EXPECT_EQ(0, logKlpMsg(-1, "o", 2, "0123456789abcdefghij", &ctx, 0));
  uint16_t len;
  memcpy(&len, buf, sizeof len);
  EXPECT_EQ(15, len);
  EXPECT_EQ("KLP8999D 012345", std::string(buf + 2));
  for (size_t i = 2 + 16; i < sizeof buf; ++i) EXPECT_EQ('#', buf[i]);

  char big[2 + 1024];
  klpMsgCtx whole{1, 0, 0, 1024, big};
  logKlpMsg(8006, "o", 2, "X", &whole, 0);
  memcpy(&len, big, sizeof len);
  EXPECT_EQ(std::string(big + 2), std::string("KLP8006D  \"KlpKCcmd\" : \"\" : \"\" : Element "
                                              "\"X\" is out of range."));
  EXPECT_EQ(strlen(big + 2), len);

  char alsoBuf[2 + 64];
  auto c = inChild([&] {
    return logKlpMsgAndText(-1, "o", 2, alsoBuf, 64, "both ways", 0) == 0 &&
                   std::string(alsoBuf + 2) == "KLP8999D both ways"
               ? 0
               : 1;
  });
  EXPECT_EQ(0, c.exitCode);
  EXPECT_NE(std::string::npos, c.out.find("KLP8999D both ways"));
  klpSetProcessLogger(nullptr);
}

TEST_F(LoggerTest, SqlAndQueueErrors) {
  auto c = inChild([&] {
    msgLogger l(MSG_APP_KLPKCCMD, 0);
    l.setProgramQualifier("KLP");
    klpSetProcessLogger(&l);
    msgSqlca ca{};
    ca.sqlcode = -204;
    memcpy(ca.sqlstate, "42704", 5);
    ca.sqlerrml = 30000;  // a length that cannot be true: never read past the field
    memset(ca.sqlerrmc, 'T', sizeof ca.sqlerrmc);
    memcpy(ca.sqlerrp, "SQLNQ1F0EXTRA", 8);
    logSqlError(&ca, "sql", KLP_DEST_CONSOLE, nullptr, "b", "c");
    ca.sqlcode = -952;
    logSqlError(&ca, "sql", KLP_DEST_CONSOLE, "a", "b", "c");
    ca.sqlcode = -964;
    ca.sqlerrml = 2;
    logSqlError(&ca, "sql", KLP_DEST_CONSOLE, "full", "b", "c");
    logXqError(2059, "mq", KLP_DEST_CONSOLE, 0, "MQCONN", "QM1");
    klpSetProcessLogger(nullptr);
    return 0;
  });
  ASSERT_TRUE(c.exited);
  auto out = lines(c.out);
  ASSERT_EQ(4u, out.size()) << c.out;
  std::string tokens(70, 'T');
  EXPECT_NE(std::string::npos,
            out[0].find("message number \"552\" containing \"9\" substitution fields: "
                        "\"KlpKCcmd\", \"KLP\" : \"\", \"*\", \"b\", \"c\", \"-204\", \"42704\", \"" +
                        tokens + "\", \"SQLNQ1F0\""))
      << out[0];
  EXPECT_NE(std::string::npos, out[1].find("\"-964\", \"42704\", \"TT\""));
  EXPECT_NE(std::string::npos, out[2].find("number \"554\""));
  EXPECT_NE(std::string::npos, out[2].find("\"full\""));
  EXPECT_NE(std::string::npos, out[3].find("\"2059\", \"MQCONN\", \"QM1\""));
}

TEST_F(LoggerTest, DefinitionsHeaderAlwaysEndsWithEndif) {
  auto c = inChild([&] {
    if (chdir(tmp.path().c_str()) != 0) return 2;
    msgLogger l(MSG_APP_KLPKCCMD, 0);
    l.loadBuiltinMsgs(builtinMsgTable);
    l.putKlpMsg(8006, MSG_DEST_HEADER, "o", "t", "X");
    std::string first = klptest::readFile("klpmsgd.h");
    l.putKlpMsg(9011, MSG_DEST_HEADER, "o", "t");
    l.putKlpMsg(600, MSG_DEST_HEADER, "o", "t");  // not found: nothing defined
    FixedTextLogger cat("KLP0700I from the catalogue");
    cat.putKlpMsg(700, MSG_DEST_HEADER, "o", "t");
    msgCloseMsgHeader();
    return first.size() > 7 && first.compare(first.size() - 7, 7, "#endif\n") == 0 ? 0 : 3;
  });
  ASSERT_TRUE(c.exited);
  EXPECT_EQ(0, c.exitCode);
  std::string h = klptest::readFile(tmp.path() + "klpmsgd.h");
  ASSERT_GT(h.size(), 7u);
  EXPECT_EQ("#endif\n", h.substr(h.size() - 7));
  EXPECT_EQ(0u, h.find("//  This file is generated"));
  EXPECT_NE(std::string::npos, h.find("//  This file was generated on "));
  EXPECT_NE(std::string::npos,
            h.find("//--------------------------------------------------\n#ifndef "
                   "MSGDEFS_INCLUDED\n#define MSGDEFS_INCLUDED\n"));
  EXPECT_NE(std::string::npos,
            h.find("#define KlpMsg8006  8006 // Extension: KLP8006D  \"KlpKCcmd\""));
  EXPECT_NE(std::string::npos,
            h.find("#undef KlpMsg7654\n  #define KlpMsg7654  9011 // Override:  KLP7654E"));
  EXPECT_NE(std::string::npos,
            h.find("#define KlpMsg0700   700 // Catalog :  KLP0700I from the catalogue\n"));
  EXPECT_EQ(std::string::npos, h.find("0553"));
  EXPECT_EQ(1u, [&] {
    size_t n = 0;
    for (size_t p = h.find("#endif"); p != std::string::npos; p = h.find("#endif", p + 1)) ++n;
    return n;
  }());
}

TEST_F(LoggerTest, DefinitionsHeaderOpenFailureReportedOnce) {
  auto c = inChild([&] {
    if (chdir(tmp.path().c_str()) != 0) return 2;
    if (mkdir("klpmsgd.h", 0700) != 0) return 3;  // a directory cannot be opened as the file
    msgLogger l(MSG_APP_KLPKCCMD, 0);
    l.loadBuiltinMsgs(builtinMsgTable);
    l.putKlpMsg(8999, MSG_DEST_HEADER, "o", "t", "one");
    l.putKlpMsg(8999, MSG_DEST_HEADER, "o", "t", "two");
    return 0;
  });
  ASSERT_TRUE(c.exited);
  EXPECT_EQ(0, c.exitCode);
  auto err = lines(c.err);
  ASSERT_EQ(3u, err.size()) << c.err;
  EXPECT_EQ(0u, err[0].find("KLP0514E \"KlpKCcmd\" : \"\" : \"t\" :  The program could not open "
                            "the log file named \"klpmsgd.h\", reason: \""))
      << err[0];
  EXPECT_EQ("KLP8999D one", err[1]);
  EXPECT_EQ("KLP8999D two", err[2]);
}

TEST_F(LoggerTest, AsynchronousModeQueuesFileOutput) {
  auto c = inChild([&] {
    msgLogger l(MSG_APP_KLPKCCMD, 1);
    prepare(l, false);
    l.putKlpMsg(8999, MSG_DEST_LOGFILE | MSG_DEST_STDOUT, "o", "t", "first");
    l.putKlpMsg(8999, MSG_DEST_LOGFILE, "o", "t", "second");
    // The console was served at once; the file waits for the logger thread.
    if (!klptest::readFile(logPath()).empty()) return 2;
    if (l.serveQueuedMsg(10) != 1) return 3;
    if (l.serveQueuedMsg(10) != 0) return 4;
    if (l.serveQueuedMsg(0) != -1) return 5;
    // Records queued from several threads are all served by one consumer.
    std::atomic<int> served{0};
    std::thread consumer([&] {
      for (int spins = 0; served < 40 && spins < 2000; ++spins)
        if (l.serveQueuedMsg(5) >= 0) ++served;
    });
    std::thread producers[4];
    for (auto& p : producers)
      p = std::thread([&] {
        for (int i = 0; i < 10; ++i) l.putKlpMsg(8999, MSG_DEST_LOGFILE, "o", "t", "many");
      });
    for (auto& p : producers) p.join();
    consumer.join();
    l.putKlpMsg(8999, MSG_DEST_LOGFILE, "o", "t", "drained by stop");
    l.stopLogging();
    return served == 40 ? 0 : 6;
  });
  ASSERT_TRUE(c.exited);
  EXPECT_EQ(0, c.exitCode);
  auto out = lines(c.out);
  ASSERT_EQ(1u, out.size()) << c.out;
  EXPECT_NE(std::string::npos, out[0].find("KLP8999D first"));
  auto file = lines(log());
  ASSERT_EQ(43u, file.size()) << log();
  EXPECT_NE(std::string::npos, file[0].find("KLP8999D first"));
  EXPECT_NE(std::string::npos, file[1].find("KLP8999D second"));
  EXPECT_NE(std::string::npos, file[42].find("KLP8999D drained by stop"));
}

}  // namespace
