// The logger's routing and destinations, lost messages, and what is issued.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <atomic>
#include <cstring>
#include <new>
#include <regex>
#include <string>
#include <vector>

#include "common/msg/msglogger.h"
#include "common/util/klprc.h"
#include "tests/testing/klptest.h"

// Every allocation of the logger is a nothrow one: a test makes the one after
// `allocationsLeft` more fail.
static std::atomic<int> allocationsLeft{-1};
void* operator new(std::size_t n, const std::nothrow_t&) noexcept {
  return allocationsLeft >= 0 && allocationsLeft-- == 0 ? nullptr : ::operator new(n);
}
void* operator new[](std::size_t n, const std::nothrow_t&) noexcept {
  return allocationsLeft >= 0 && allocationsLeft-- == 0 ? nullptr : ::operator new[](n);
}

namespace {

// The lines of a text without their time stamps ("!" marks a line without).
std::string unstamped(const std::string& text) {
  std::regex stamp("\\d{4}-\\d\\d-\\d\\d-\\d\\d\\.\\d\\d\\.\\d\\d\\.\\d{6} .*");
  std::string out;
  for (const std::string& l : klptest::lines(text))
    out += (std::regex_match(l, stamp) ? l.substr(27) : "!" + l) + "\n";
  return out;
}

// A logger with the built-in texts, the qualifier "KLP" and test.log.
struct LoggerTest : ::testing::Test {
  klptest::TmpDir tmp;
  msgLogger l{MSG_APP_KLPKCCMD, 0};
  void SetUp() override { prepare(l); }
  void prepare(msgLogger& logger) {
    logger.loadBuiltinMsgs(builtinMsgTable);
    logger.setProgramQualifier("KLP");
    logger.setLogFileName(tmp.path().c_str(), "test.log");
  }
  std::string log() const { return unstamped(klptest::readFile(tmp.path() + "test.log")); }
};

// A logger whose messages all have one text (as if from the catalogue); what
// setRouting makes of the last one is kept instead of printed.
template <class Base>
struct Fixed : Base {
  const char* fixed;
  std::string routed;
  explicit Fixed(const char* text) : Base(MSG_APP_KLPKCCMD, 0), fixed(text) {}
  void composeKlpMsg(logMsg* r) override {
    snprintf(r->text, static_cast<size_t>(r->textSize) + 1, "%s", fixed);
    r->sourceKind = MSG_SOURCE_CATALOG;
  }
  void setRouting(logMsg* r) override {
    Base::setRouting(r);
    routed = std::to_string(r->routing) + " " + r->text;
  }
  void writeConsole(logMsg*) override {}
  std::string route(int console, int asked) {
    this->setConsoleFlag(console);
    this->putKlpMsg(700, static_cast<uint16_t>(asked), "o", "t");
    return routed;
  }
};
// Words of msgLogger I 12, W 12, E 10, other 8; of msgLoggerU 28, 26, 26, 8. Bit 1
// adds the word of the severity read from the text (made upper case); 4 needs LOGSTDOUT.
TEST(Routing, FollowsTheSeverityWordsAndTheConsoleFlag) {
  const struct { bool u; const char* text; int console, asked; const char* want; } rows[] = {
      {false, "KLP0700I i", 0, 1, "8 KLP0700I i"},      {false, "KLP0700I i", 1, 1, "12 KLP0700I i"},
      {false, "KLP0700W w", 0, 1, "8 KLP0700W w"},      {false, "KLP0700E e", 0, 1, "10 KLP0700E e"},
      {false, "KLP0700X d", 1, 1, "8 KLP0700X d"},      {false, "no id", 1, 1, "8 no id"},
      {true, "KLP0700I i", 0, 1, "24 KLP0700I i"},      {true, "KLP0700I i", 1, 1, "28 KLP0700I i"},
      {true, "KLP0700w w", 0, 1, "26 KLP0700W w"},      {true, "KLP0700e e", 0, 1, "26 KLP0700E e"},
      {true, "x KLP0700i", 0, 1, "24 x KLP0700I"},      {true, "KLP0701E x", 1, 1, "8 KLP0701E x"},
      {true, "KLP0700D d", 1, 1, "8 KLP0700D d"},       {false, "KLP0700E e", 0, 12, "8 KLP0700E e"},
      {false, "KLP0700E e", 1, 12, "12 KLP0700E e"},    {true, "KLP0700W w", 0, 33, "58 KLP0700W w"},
  };
  for (const auto& r : rows)
    EXPECT_EQ(r.want, r.u ? Fixed<msgLoggerU>(r.text).route(r.console, r.asked)
                          : Fixed<msgLogger>(r.text).route(r.console, r.asked));
}

// Each line opens, writes and closes the log file (one moved away starts anew);
// a failed open is reported once until a line is written again; origin and
// thread name are cut to 30 and 15 characters.
TEST_F(LoggerTest, TheLogFile) {
  std::string bad = tmp.path() + "missing-dir", t = "01234567890123456789", log = tmp.path() + "test.log";
  auto c = klptest::inChild(tmp.path(), [&] {
    l.setLogFileName("", "");
    l.putKlpMsg(8999, MSG_DEST_LOGFILE, "o", "t", "no log file yet");
    for (std::string step : {"bad", "lost 1", "lost 2", "good", "one", "move", "two", "bad", "lost 3"}) {
      if (step == "bad") l.setLogFileName(bad.c_str(), "x.log");
      else if (step == "good") l.setLogFileName(tmp.path().c_str(), "test.log");
      else if (step == "move") rename(log.c_str(), (tmp.path() + "moved.log").c_str());
      else l.putKlpMsg(8006, MSG_DEST_LOGFILE, (t + t).c_str(), t.c_str(), step.c_str());
    }
    return 0;
  });
  EXPECT_EQ("", c.out);
  std::string failed = "KLP0514E \"KlpKCcmd\" : \"KLP\" : \"Initial\" :  The program could not "
                       "open the log file named \"" + bad + "/x.log\", reason: \"No such file or "
                       "directory\"\n";
  EXPECT_EQ(failed + failed, unstamped(c.err));
  std::string line = "<012345678901234567890123456789> KLP8006D  \"KlpKCcmd\" : \"KLP\" : "
                     "\"012345678901234\" : Element \"";
  EXPECT_EQ(line + "one\" is out of range.\n", unstamped(klptest::readFile(tmp.path() + "moved.log")));
  EXPECT_EQ(line + "two\" is out of range.\n", unstamped(klptest::readFile(log)));
  l.clearLog();
  struct stat st;
  EXPECT_TRUE(stat(log.c_str(), &st) == 0 && st.st_size == 0);
  std::string longDir(1100, 'd');
  const struct { const char *dir, *file, *joined; } names[] = {{"/a/b", "c", "/a/b/c"},
      {"/a/b/", "c", "/a/b/c"}, {"", "c", "c"}, {longDir.c_str(), "c", ""}};  // never a cut path
  for (const auto& n : names) EXPECT_STREQ(n.joined, l.setLogFileName(n.dir, n.file));
  EXPECT_EQ(std::string(128, 's') + ".T", l.setMsgTableName(std::string(200, 's').c_str(), "T"));
}

// Asynchronous mode serves the console at once and queues the rest; stopLogging
// drains the queue and stops file output until restartLogging.
TEST_F(LoggerTest, QueuedFileOutputStopAndRestart) {
  auto c = klptest::inChild(tmp.path(), [&] {
    msgLogger q(MSG_APP_KLPKCCMD, 1);
    prepare(q);
    q.putKlpMsg(8999, MSG_DEST_LOGFILE | MSG_DEST_STDOUT, "o", "t", "first");
    q.putKlpMsg(8999, MSG_DEST_LOGFILE, "o", "t", "second");
    if (log() != "") return 2;
    if (q.serveQueuedMsg(10) != 1 || q.serveQueuedMsg(10) != 0 || q.serveQueuedMsg(0) != -1) return 3;
    q.putKlpMsg(8999, MSG_DEST_LOGFILE, "o", "t", "drained by stop");
    q.stopLogging();
    q.putKlpMsg(8999, MSG_DEST_LOGFILE | MSG_DEST_STDOUT, "o", "t", "while stopped");
    q.restartLogging("restarter");
    return q.serveQueuedMsg(10) == 0 ? 0 : 4;
  });
  EXPECT_EQ(0, c.exitCode);
  EXPECT_EQ("KLP8999D first\nKLP8999D while stopped\n", unstamped(c.out));
  EXPECT_EQ("<o> KLP8999D first\n<o> KLP8999D second\n<o> KLP8999D drained by stop\n"
            "<restarter> KLP8999D Message logging re-enabled\n", log());
}

// A message without memory for its record, text or a value is lost and says
// so; one without memory for its log line goes to standard error.
TEST_F(LoggerTest, NoMessageIsLostSilentlyForWantOfMemory) {
  constexpr int kTries = 30;
  auto c = klptest::inChild(tmp.path(), [&] {
    int lost = 0;
    for (int n = 0; n < kTries; ++n) {
      allocationsLeft = n;
      lost += l.putKlpMsg(8006, MSG_DEST_LOGFILE, "o", "t", "X") == 801;
    }
    for (int n : {0, 2}) {  // the record, a value: an empty text
      char text[64] = "untouched";
      allocationsLeft = n;
      if (l.getKlpMsgText(8006, "o", "t", text, sizeof text, "X") != -1 || text[0]) return 100;
    }
    return lost;
  });
  EXPECT_GE(c.exitCode, 3);  // record, text, value at least
  std::string line = "msgLogger::putKlpMsg : Failed to log klpMsgId '8006' due to insufficient "
                     "memory.";
  EXPECT_EQ(std::vector<std::string>(c.exitCode, line), klptest::lines(c.out));
  EXPECT_EQ(kTries - c.exitCode, klptest::lines(log()).size() + klptest::lines(c.err).size());
}

std::vector<std::string> tableRows;
int tableAnswer = 0;
int writeTableRow(const char* table, const char* qualifier, const logMsg* r) {
  tableRows.push_back(std::string(table) + "|" + qualifier + "|" + std::to_string(r->msgNumber));
  return tableAnswer;
}
// Only msgLoggerU writes the table, once per message, with the qualifier as
// "%-18.18s", and leaves it alone for a while after the database is gone.
TEST(MessageTable, RowsAreWrittenUntilTheDatabaseIsGone) {
  const std::string row = "KLP.MSGS|KLP               |", longRow = "KLP.MSGS|ABCDEFGHIJKLMNOPQR|8999";
  const struct { bool u; const char *schema, *qualifier; int number, routing, answer;
                 std::vector<std::string> rows; } cases[] = {
      {true, nullptr, "KLP", 8999, 16, 0, {}},
      {false, "KLP", "KLP", 8999, 16, 0, {}},
      {true, "KLP", "KLP", 8999, 16, 0, {row + "8999", row + "8999"}},
      {true, "KLP", "ABCDEFGHIJKLMNOPQRSTUV", 8999, 16, 0, {longRow, longRow}},
      {true, "KLP", "KLP", 9005, 1 | 16, -204, {row + "7142", row + "7142"}},  // 'I': word 28
      {true, "KLP", "KLP", 8999, 1, 0, {}},                                  // 'D': word 8
      {true, "KLP", "KLP", 8999, 16, -968, {row + "8999"}},
      {true, "KLP", "KLP", 8999, 16, -289, {row + "8999"}},
      {true, "KLP", "KLP", 8999, 16, -904, {row + "8999"}}};
  msgSetTableWriter(writeTableRow);
  for (const auto& c : cases) {
    std::unique_ptr<msgLogger> l(c.u ? createMsgLoggerU(MSG_APP_KLPKCCMD, 0)
                                     : new msgLogger(MSG_APP_KLPKCCMD, 0));
    l->loadBuiltinMsgs(builtinMsgTable);
    l->setProgramQualifier(c.qualifier);
    if (c.schema != nullptr) l->setMsgTableName(c.schema, "MSGS");
    tableRows.clear();
    tableAnswer = c.answer;
    for (int i = 0; i < 2; ++i) l->putKlpMsg(c.number, c.routing, "o", "t", "v");
    EXPECT_EQ(c.rows, tableRows) << c.number << " answered " << c.answer;
  }
  msgSetTableWriter(nullptr);
}

// One definition per message found, kept before the header's last line; a
// header that cannot be opened is reported once.
TEST_F(LoggerTest, DefinitionsHeader) {
  auto c = klptest::inChild(tmp.path(), [&] {
    if (chdir(tmp.path().c_str()) != 0) return 2;
    for (int number : {8006, 9011, 600}) l.putKlpMsg(number, MSG_DEST_HEADER, "o", "t", "X");
    Fixed<msgLogger>("KLP0700I from the catalogue").putKlpMsg(700, MSG_DEST_HEADER, "o", "t");
    msgCloseMsgHeader();
    if (rename("klpmsgd.h", "done.h") != 0 || mkdir("klpmsgd.h", 0700) != 0) return 3;
    for (const char* v : {"one", "two"}) l.putKlpMsg(8999, MSG_DEST_HEADER, "o", "t", v);
    return 0;
  });
  std::string h = klptest::readFile(tmp.path() + "done.h"), banner = "//---------------------------"
      "-----------------------\n#ifndef MSGDEFS_INCLUDED\n#define MSGDEFS_INCLUDED\n";
  EXPECT_EQ("#define KlpMsg8006  8006 // Extension: KLP8006D  \"KlpKCcmd\" : \"KLP\" : \"t\" : Element "
            "\"X\" is out of range.\n#undef KlpMsg7654\n  #define KlpMsg7654  9011 // Override:  "
            "KLP7654E  \"KlpKCcmd\" : \"KLP\" : \"t\" : The autostop and applyupto parameters cannot be "
            "specified at the same time when operating the K Apply program. \n#define KlpMsg0700   "
            "700 // Catalog :  KLP0700I from the catalogue\n#endif\n",
            h.substr(h.find(banner) + banner.size()));
  EXPECT_EQ(0u, c.err.find("KLP0514E \"KlpKCcmd\" : \"KLP\" : \"t\" :  The program could not open the "
                           "log file named \"klpmsgd.h\", reason: \"Is a directory\"\nKLP8999D one\n"
                           "KLP8999D two\n")) << c.err;
}

msgSqlca sqlca(int code, int16_t tokenLength) {
  msgSqlca ca{};
  ca.sqlcode = code, ca.sqlerrml = tokenLength;
  memcpy(ca.sqlstate, "42704", 5);
  memset(ca.sqlerrmc, 'T', sizeof ca.sqlerrmc);
  memcpy(ca.sqlerrp, "SQLNQ1F0EXTRA", 8);
  return ca;
}
// What each issuing function of this library issues: number, origin, routing
// asked for and the caller's values, in order.
TEST(Issuing, EachFunctionIssuesItsMessages) {
  const std::string tokens(70, 'T');
  msgSetStringParmProvider([](int i) { return i == 29 ? "parm 29" : i == 17 ? "parm 17" : "?"; });
  const struct { int app; std::function<void()> call; std::vector<std::string> issued; } rows[] = {
      {10, [] { logKlpMsg(-1, "free", 2, "just text", nullptr, 0); }, {"8999 <free> 35: just text"}},
      {10, [] { logKlpMsg(8005, "state", 0, "thr", nullptr, 1, "7"); }, {"8005 <state> 12: thr|7"}},
      {10, [] { logKlpMsg(8006, "nine", 7, "a", nullptr, 9, "b", "c", "d", "e", "f", "g", "h", "i",
                          "j"); }, {"8006 <nine> 1: a|b|c|d|e|f|g"}},
      {10, [] { klpMsgCtx ctx{0, 5, 6, 0, nullptr}; logKlpMsg(8999, "x", 1, "v", &ctx, 0); },
       {"8999 <x> 1: v (5,6)"}},
      {10, [] { logInternalError("where", 801, "what", "the detail"); },
       {"589 <where> 1: where|801|what", "8999 <where> 8: the detail"}},
      {10, [] { logInternalError("where", 2002, "op", ""); }, {"589 <where> 1: where|2002|op"}},
      {10, [] { auto ca = sqlca(-204, 30000); logSqlError(&ca, "sql", 2, nullptr, "b", "c"); },
       {"552 <sql> 3: |b|c|-204|42704|" + tokens + "|SQLNQ1F0"}},
      {10, [] { auto ca = sqlca(-964, 2); logSqlError(&ca, "sql", 0, "full", "b", "c"); },
       {"552 <sql> 12: full|b|c|-964|42704|TT|SQLNQ1F0", "554 <sql> 12: full"}},
      {10, [] { auto ca = sqlca(-952, 2); logSqlError(&ca, "sql", 1, "a", "b", "c"); }, {}},
      {10, [] { logXqError(2059, "mq", 2, 0, "MQCONN", "QM1"); },
       {"575 <mq> 35: 2059|MQCONN|QM1 (-1,2059)"}},
      {5, [] { logXqError(2162, "mq", 0, 1, "a", "b"); }, {"574 <mq> 12: parm 29"}},
      {6, [] { logXqError(2161, "mq", 1, 1, "a", "b"); }, {"574 <mq> 1: parm 17"}},
      {10, [] { logXqError(2059, "mq", 1, 1, "a", "b"); }, {"574 <mq> 1: "}},
      {5, [] { logXqError(2058, "mq", 1, 1, "a", "b"); }, {"575 <mq> 1: 2058|a|b (-1,2058)"}},
      {10, [] { klpGetProcessLogger()->restartLogging("again"); },
       {"8999 <again> 1: Message logging re-enabled"}},
      // A text asked for goes to its buffer (length, characters, NUL), not issued.
      {10, [] {
         char b[26];
         klpMsgCtx ctx{1, 0, 0, 16, static_cast<char*>(memset(b, '#', sizeof b))};
         EXPECT_EQ(0, logKlpMsg(-1, "o", 2, "0123456789abcdefghij", &ctx, 0));
         EXPECT_EQ(std::string("\x0f\0KLP8999D 012345\0########", 26), std::string(b, 26));
       }, {}},
      {10, [] {
         char both[2 + 64];
         EXPECT_EQ(0, logKlpMsgAndText(-1, "o", 1, both, 64, "both ways", 0));
         EXPECT_STREQ("KLP8999D both ways", both + 2);
       }, {"8999 <o> 1: both ways"}},
  };
  for (size_t i = 0; i < std::size(rows); ++i) {
    klptest::ProcessLogger logger(rows[i].app);
    rows[i].call();
    EXPECT_EQ(rows[i].issued, logger.take()) << "row " << i;
  }
  msgSetStringParmProvider(nullptr);
  EXPECT_EQ(KLP_RC_BAD_PARM, logKlpMsg(8999, "o", 1, "x", nullptr, 0));  // no process logger
}

}  // namespace
