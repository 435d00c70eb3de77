// The logger: texts, the catalogue, routing, destinations, lost messages, what is issued.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <atomic>
#include <cstring>
#include <fstream>
#include <functional>
#include <new>
#include <regex>
#include <string>
#include <vector>

#include "common/msg/msglogger.h"
#include "common/util/klprc.h"
#include "tests/testing/klptest.h"

// The logger allocates with nothrow new only: a test makes the one after `allocationsLeft` fail.
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

// A logger with the built-in texts (no catalogue), the qualifier "KLP" and test.log.
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
  std::string text(int number, const char* v1 = nullptr, const char* v2 = nullptr) {
    char buf[2048];
    l.getKlpMsgText(number, "test", "T", buf, sizeof buf, v1, v2);
    return buf;
  }
  // The nine values putKlpMsg stores (missing: "*") joined by "|", or their lengths by " ".
  std::string values(int number, std::vector<const char*> v, bool lengths = false) {
    logMsg* r = msgNewRecord(number, 0, "test", "T");
    v.resize(MSG_MAX_VALUES);
    l.setMsgValues(r, MSG_MAX_VALUES, v.data());
    std::string out;
    for (int i = 0; i < r->valueCount; ++i)
      out += (i ? (lengths ? " " : "|") : "") + (lengths ? std::to_string(strlen(r->values[i])) : r->values[i]);
    msgFreeRecord(r);
    return out;
  }
};

// One text for every message (as from the catalogue); the last routing is kept, not printed.
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
// Words I/W/E/other: msgLogger 12/12/10/8, U 28/26/26/8; bit 1 adds the text's, 4 needs LOGSTDOUT.
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

// A moved file starts anew; a failed open reported once per good line; origin, thread cut to 30, 15.
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
  std::string failed = "KLP0514E \"KlpKCcmd\" : \"KLP\" : \"Initial\" :  The program could not open the log "
                       "file named \"" + bad + "/x.log\", reason: \"No such file or directory\"\n";
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

// Asynchronous: console at once, the rest queued; stopLogging drains, files wait for restart.
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

// Lost for want of memory (record, text, value): said so; no memory for its line: to stderr.
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
  std::string line = "msgLogger::putKlpMsg : Failed to log klpMsgId '8006' due to insufficient memory.";
  EXPECT_EQ(std::vector<std::string>(c.exitCode, line), klptest::lines(c.out));
  EXPECT_EQ(kTries - c.exitCode, klptest::lines(log()).size() + klptest::lines(c.err).size());
}

std::vector<std::string> tableRows;
int tableAnswer = 0;
// Only msgLoggerU writes rows, qualifier "%-18.18s", and stops for a while once the database is gone.
TEST(MessageTable, RowsAreWrittenUntilTheDatabaseIsGone) {
  const std::string row = "KLP.MSGS|KLP               |", longRow = "KLP.MSGS|ABCDEFGHIJKLMNOPQR|8999";
  const struct { std::vector<std::string> rows; int answer = 0, number = 8999, routing = 16;
                 const char* qualifier = "KLP"; bool u = true; const char* schema = "KLP"; } cases[] = {
      {{}, 0, 8999, 16, "KLP", true, nullptr}, {{}, 0, 8999, 16, "KLP", false},
      {{row + "8999", row + "8999"}}, {{longRow, longRow}, 0, 8999, 16, "ABCDEFGHIJKLMNOPQRSTUV"},
      {{row + "7142", row + "7142"}, -204, 9005, 1 | 16},  // 'I': word 28
      {{}, 0, 8999, 1},                                     // 'D': word 8
      {{row + "8999"}, -968}, {{row + "8999"}, -289}, {{row + "8999"}, -904}};
  msgSetTableWriter([](const char* table, const char* qualifier, const logMsg* r) {
    tableRows.push_back(std::string(table) + "|" + qualifier + "|" + std::to_string(r->msgNumber));
    return tableAnswer;
  });
  for (const auto& c : cases) {
    std::unique_ptr<msgLogger> l(c.u ? createMsgLoggerU(MSG_APP_KLPKCCMD, 0) : new msgLogger(MSG_APP_KLPKCCMD, 0));
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

// One definition per message, before the header's last line; an unopenable header reported once.
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
// What each issuing function issues: number, origin, routing asked for, the caller's values.
TEST(Issuing, EachFunctionIssuesItsMessages) {
  const std::string tokens(70, 'T');
  msgSetStringParmProvider([](int i) { return i == 29 ? "parm 29" : i == 17 ? "parm 17" : "?"; });
  const struct { std::function<void()> call; std::vector<std::string> issued; int app = 10; } rows[] = {
      {[] { logKlpMsg(-1, "free", 2, "just text", nullptr, 0); }, {"8999 <free> 35: just text"}},
      {[] { logKlpMsg(8005, "state", 0, "thr", nullptr, 1, "7"); }, {"8005 <state> 12: thr|7"}},
      {[] { logKlpMsg(8006, "nine", 7, "a", nullptr, 9, "b", "c", "d", "e", "f", "g", "h", "i", "j"); },
       {"8006 <nine> 1: a|b|c|d|e|f|g"}},
      {[] { klpMsgCtx ctx{0, 5, 6, 0, nullptr}; logKlpMsg(8999, "x", 1, "v", &ctx, 0); }, {"8999 <x> 1: v (5,6)"}},
      {[] { logInternalError("where", 801, "what", "the detail"); },
       {"589 <where> 1: where|801|what", "8999 <where> 8: the detail"}},
      {[] { logInternalError("where", 2002, "op", ""); }, {"589 <where> 1: where|2002|op"}},
      {[] { auto ca = sqlca(-204, 30000); logSqlError(&ca, "sql", 2, nullptr, "b", "c"); },
       {"552 <sql> 3: |b|c|-204|42704|" + tokens + "|SQLNQ1F0"}},
      {[] { auto ca = sqlca(-204, -3); logSqlError(&ca, "sql", 2, nullptr, "b", "c"); },  // no tokens
       {"552 <sql> 3: |b|c|-204|42704||SQLNQ1F0"}},
      {[] { auto ca = sqlca(-964, 2); logSqlError(&ca, "sql", 0, "full", "b", "c"); },
       {"552 <sql> 12: full|b|c|-964|42704|TT|SQLNQ1F0", "554 <sql> 12: full"}},
      {[] { auto ca = sqlca(-952, 2); logSqlError(&ca, "sql", 1, "a", "b", "c"); }, {}},
      {[] { logXqError(2059, "mq", 2, 0, "MQCONN", "QM1"); }, {"575 <mq> 35: 2059|MQCONN|QM1 (-1,2059)"}},
      {[] { logXqError(2162, "mq", 0, 1, "a", "b"); }, {"574 <mq> 12: parm 29"}, 5},
      {[] { logXqError(2161, "mq", 1, 1, "a", "b"); }, {"574 <mq> 1: parm 17"}, 6},
      {[] { logXqError(2059, "mq", 1, 1, "a", "b"); }, {"574 <mq> 1: "}},
      {[] { logXqError(2058, "mq", 1, 1, "a", "b"); }, {"575 <mq> 1: 2058|a|b (-1,2058)"}, 5},
      {[] { klpGetProcessLogger()->restartLogging("again"); }, {"8999 <again> 1: Message logging re-enabled"}},
      // A text asked for goes to its buffer (length, characters, NUL), not issued.
      {[] {
         char b[26];
         klpMsgCtx ctx{1, 0, 0, 16, static_cast<char*>(memset(b, '#', sizeof b))};
         EXPECT_EQ(0, logKlpMsg(-1, "o", 2, "0123456789abcdefghij", &ctx, 0));
         EXPECT_EQ(std::string("\x0f\0KLP8999D 012345\0########", 26), std::string(b, 26));
       }, {}},
      {[] {
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

TEST(BuiltinTable, LoadsWellFormedRowsOnceAndTheFirstDefinitionWins) {
  msgLogger l(MSG_APP_KLPKCCMD, 0);
  EXPECT_EQ(116, l.loadBuiltinMsgs(builtinMsgTable));
  EXPECT_EQ(0, l.loadBuiltinMsgs(builtinMsgTable));
  EXPECT_EQ(0, l.loadBuiltinMsgs(builtinMsgTable + 116) + l.loadBuiltinMsgs(nullptr) + l.addBuiltinMsg(nullptr));
  const std::pair<const char*, int> rows[] = {
      {"KLP0000D zero", 0}, {"KLP9999D too big", 0}, {"XYZ8100D not ours", 0}, {"KLP81", 0},
      {"KLP8a00D", 0},      {"KLP8100D first", 1},   {"KLP8100D second", 0},   {"KLP8200D other", 1},
      {"KLP0001D low", 1},  {"KLP9998D high", 1}};  // 8200 shares the bucket of 8100
  for (auto [row, added] : rows) EXPECT_EQ(added, l.addBuiltinMsg(row)) << row;
  logMsg* r = msgNewRecord(0, 0, "o", "T");
  for (auto [number, found] : {std::pair{8100, "KLP8100D first"}, {8200, "KLP8200D other"},
                               {1, "KLP0001D low"}, {9998, "KLP9998D high"}, {8300, ""},
                               {-1, ""}, {-100, ""}, {10000, ""}}) {
    r->text[0] = '\0';
    EXPECT_EQ(found[0] != '\0', l.lookupBuiltinMsg(number, 1024, r)) << number;
    EXPECT_STREQ(found, r->text);
  }
  msgFreeRecord(r);
}

TEST_F(LoggerTest, TextsComposeFromTheirRowsValuesAndHeaderValues) {
  const std::string h = "  \"KlpKCcmd\" : \"KLP\" : \"T\" : ", stars = "\"*\", \"*\", \"*\", \"*\", \"*\"";
  const struct { int number; const char *v1, *v2; std::string want; } rows[] = {
      {8999, "Message logging re-enabled", nullptr, "KLP8999D Message logging re-enabled"},
      {8006, "X", nullptr, "KLP8006D" + h + "Element \"X\" is out of range."},
      {8000, "E", "L", "KLP8000D" + h + "List element named \"E\" is invalidly chainedon list named \"L\"."},
      {8005, "", nullptr, "KLP8005D" + h + "Thread \"*\" is in un-expected state \"*\"."},
      {661, "X", nullptr, "KLP0661E Job was cancelled"},
      {9011, "x", nullptr, "KLP7654E" + h + "The autostop and applyupto parameters cannot be specified at the "
                           "same time when operating the K Apply program. "},
      {600, "A", "B", "KLP0553W" + h + "An internal error  \"4\" occurred for message number \"600\" containing "
                      "\"9\" substitution fields: \"KlpKCcmd\", \"KLP\" : \"T\", \"A\", \"B\", " + stars},
      // Negative numbers are outside the table, never an out-of-range bucket.
      {-7, "A", nullptr, "KLP0553W" + h + "An internal error  \"4\" occurred for message number \"-7\" "
                         "containing \"9\" substitution fields: \"A\", \"*\", \"*\", \"*\", " + stars},
      // Control characters escaped: another process's value must not end or split the line.
      {8999, "Q1\nKLP0522I forged\r\t", nullptr, "KLP8999D Q1\\nKLP0522I forged\\r\\t"},
      {8999, "\x1b[31mred\x7f\x01", nullptr, "KLP8999D \\x1B[31mred\\x7F\\x01"},
      {8999, "back\\slash \xc3\xbc", nullptr, "KLP8999D back\\slash \xc3\xbc"},
  };
  for (const auto& r : rows) EXPECT_EQ(r.want, text(r.number, r.v1, r.v2)) << r.number;
  l.setProgramQualifier("K\nLP");
  EXPECT_EQ("KLP8006D  \"KlpKCcmd\" : \"K\\nLP\" : \"T\" : Element \"X\" is out of range.", text(8006, "X"));
  l.setProgramQualifier(std::string(200, 'Q').c_str());
  EXPECT_EQ(std::string(128, 'Q'), l.getProgramQualifier());
  std::string names;
  for (int i = -1; i <= MSG_APPLICATION_COUNT; ++i) names += msgApplicationName(i) + std::string("|");
  EXPECT_EQ("|@A|Capture|Apply|KlpCcmd|KlpAcmd|K Capture|K Apply|Klpmon|Klppwd|KlpMcmd|KlpKCcmd|"
            "KlpKAcmd|KlpTDiff|KlpKMFmt|Analyzer|K Analyzer|KlpSList|KlpTRep||", names);
  std::string big(1100, 'z');  // a text is cut at 1024, never written past the buffer
  logMsg* r = msgNewRecord(8999, 0, "t", "T");
  const char* v[MSG_MAX_VALUES] = {big.c_str()};
  l.setMsgValues(r, MSG_MAX_VALUES, v);
  l.composeKlpMsg(r);
  EXPECT_EQ("KLP8999D " + big.substr(0, 1015), r->text);
  msgFreeRecord(r);
  char buf[32];
  memset(buf, '#', sizeof buf);
  EXPECT_EQ(19, l.getKlpMsgText(8006, "t", "T", buf, 20, "X"));
  EXPECT_EQ(0, l.getKlpMsgText(8006, "t", "T", buf + 21, 0, "X"));  // untouched
  EXPECT_EQ(std::string("KLP8006D  \"KlpKCcmd\0", 20) + std::string(12, '#'), std::string(buf, 32));
}

// Header values by number range push out the last caller values; long values are cut evenly.
TEST_F(LoggerTest, HeaderValuesByRangeAndValueLengthBound) {
  const std::string none = "1|2|3|4|5|6|7|8|9", qt = "KLP\" : \"T|1|2|3|4|5|6|7|8",
                    app = "KlpKCcmd|KLP\" : \"T|1|2|3|4|5|6|7";
  const std::pair<int, const std::string*> rows[] = {
      {0, &qt},      {499, &qt},    {500, &app},   {999, &app},   {1000, &qt},   {1499, &qt},
      {1500, &none}, {1975, &none}, {1976, &app},  {1999, &app},  {2000, &none}, {3999, &none},
      {4000, &app},  {4099, &app},  {4100, &none}, {5099, &none}, {5100, &qt},   {5199, &qt},
      {5200, &none}, {6999, &none}, {7000, &app},  {8997, &app},  {8998, &none}, {-1, &none}};
  for (auto [number, want] : rows)
    EXPECT_EQ(*want, values(number, {"1", "2", "3", "4", "5", "6", "7", "8", "9"})) << number;
  // The values sum to at most 1161, a share of 129: only longer values lose, all the same amount.
  std::string v200(200, 'v'), v1000(1000, 'w'), v129(129, 's'), v130(130, 'm'), huge(20000, 'h');
  const char *p = v200.c_str(), *w = v1000.c_str(), *m = v130.c_str();
  EXPECT_EQ("129 129 129 129 129 129 129 129 129", values(8999, {p, p, p, p, p, p, p, p, p}, true));
  // 1800 over 9: excess 639, each loses 71; 2135 over two long values: 487 each.
  EXPECT_EQ("129 513 513 1 1 1 1 1 1",
            values(8999, {v129.c_str(), w, w, "a", "b", "c", "d", "e", "f"}, true));
  // The even cut (19879 / 9 = 2208) exceeds the 130-character ones: emptied, never below nothing.
  EXPECT_EQ("0 0 0 0 0 0 0 0 17792", values(8999, {m, m, m, m, m, m, m, m, huge.c_str()}, true));
}

// Markers are replaced in order; log base names are data-set or plain names.
TEST(Helpers, SubstitutionFollowsMarkerOrderAndLogBaseNames) {
  char* values[3] = {const_cast<char*>("A"), const_cast<char*>(""), const_cast<char*>("$3")};
  const struct { const char* tmpl; int count, cap; const char* want; } rows[] = {
      {"<$1|$2|$3>", 3, 127, "<A|*|$3>"},         {"no markers", 3, 127, "no markers"},
      {"$2 $1", 3, 127, "$2 A"},                  // a marker before $1 stays
      {"$1 $1 $2", 3, 127, "A $1 *"},             // replaced at its first place only
      {"$1 $2 $3 $5 $4", 3, 127, "A * $3 $5 *"},  // the value "$3" is not searched
      {"$1 $3 $2", 3, 127, "A $3 *"},             // stops at the first missing marker
      {"$1 $2 $3", 1, 127, "A * *"},              // values beyond the count are "*"
      {"<$1|$2|$3>", 3, 3, "<A|"},   {"abcdef$1", 3, 4, "abcd"},  {"x$", 3, 127, "x$"}};
  for (const auto& r : rows) {
    char out[128];
    EXPECT_EQ(static_cast<int>(strlen(r.want)),
              msgSubstitute(r.tmpl, strlen(r.tmpl), values, r.count, out, r.cap));
    EXPECT_STREQ(r.want, out) << r.tmpl;
  }
  // Log base names: data-set style under "//", plain otherwise; "": none.
  const struct { const char *path, *name; size_t room; const char* want; } names[] = {
      {"//HLQ", "MY_DB.KLP_X.KCAP", 64, "MYDB.KLPX.KCAP.LOG"}, {"//HLQ", "ONE.PART", 64, ""},
      {"//HLQ", "ABCDEFGHIJ.KLMNOPQRST.REST.MORE", 64, "ABCDEFGH.KLMNOPQR.REST.MORE.LOG"},
      {"/var/log/", "MYDB.KLP.KCAP", 64, "MYDB.KLP.KCAP.log"}, {"/x", "does-not-fit", 8, ""}};
  for (const auto& r : names) {
    char out[64] = "junk";
    EXPECT_EQ(r.want[0] != '\0', msgLogBaseName(r.path, r.name, out, r.room)) << r.name;
    EXPECT_STREQ(r.want, out);
  }
}

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

// Either byte order: a decimal id finds the first text of its own id; damage refused inside bounds.
TEST(MoReader, FindsOnlyDecimalIdsWithTheirOwnTextsAndRefusesDamage) {
  Entries entries = {
      {"", "KLP0000E header"},      {"0500", "KLP0500E leading zero"}, {"abc", "KLP0500E letters"},
      {"500", "KLP0500E first"},    {"500", "KLP0500E second"},        {"501", "KLP0500E misfiled"},
      {"502", "KLP0502X severity"}, {"503", "KLP0503"},                {"504", "hello"},
      {"12345", "KLP2345E five"},   {"7", "KLP0007W seven"},           {"9999", "KLP9999D last"}};
  for (bool big : {false, true}) {
    auto image = moImage(entries, big);
    EXPECT_EQ("KLP0500E first|KLP0007W seven|KLP9999D last",
              lookup(image, "500") + "|" + lookup(image, "7") + "|" + lookup(image, "9999"));
    for (const char* key : {"", "0", "0500", "abc", "501", "502", "503", "504", "12345", "2345", "-1"})
      EXPECT_EQ("<none>", lookup(image, key)) << key;
  }
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
  EXPECT_EQ("<damaged 3>", lookup(moImage(Entries(70000)), "500"));  // more entries than numbers, all sound
}

// Reasons: 2 missing, 3 unreadable/damaged/not a regular file (never blocks), 4 no message, 5 bad call.
TEST(Catalogue, TextsReasonsEveryIssuedNumberAndWhereProgramsLook) {
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
      {file(image), 500, 200, "reason 2", "/no/such/dir/vdbklp.mo"}, {file(image), 500, 200, "reason 5", ""}};
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
  // Every issued number has a built text: id, severity, markers filled; labels 7112+ lack header values.
  const int issued[] = {500, 501, 502, 503, 504, 506, 507, 508, 509, 510, 511, 513, 514, 517, 518, 519, 520,
                        521, 522, 523, 524, 525, 526, 527, 529, 534, 541, 543, 545, 552, 554, 568, 569, 574,
                        575, 589, 590, 591, 592, 593, 594, 595, 596, 597, 598, 599, 600, 601, 602, 606, 615,
                        616, 617, 619, 624, 626, 7112, 7113, 7114, 7115, 7116, 7117, 7118, 7119, 7120, 7121,
                        7122, 7123, 7124, 7193};
  char v[9][3] = {"v1", "v2", "v3", "v4", "v5", "v6", "v7", "v8", "v9"};
  char* nine[9] = {v[0], v[1], v[2], v[3], v[4], v[5], v[6], v[7], v[8]};
  for (int number : issued) {
    char text[1100], id[8];
    snprintf(id, sizeof id, "KLP%04d", number);
    ASSERT_GT(retrieveCatalogMsg(kCatalog.c_str(), number, nullptr, nine, 9, text, sizeof text), 0) << number;
    EXPECT_EQ(0, strncmp(text, id, 7)) << text;
    EXPECT_NE(nullptr, strchr("EIW", text[7])) << text;
    bool label = number >= 7112;
    EXPECT_EQ(0, strncmp(text + 8, label ? "  " : "  \"v1\" : \"v2\" : ", label ? 2 : 16)) << text;
    for (const char* p = text; (p = strchr(p, '$')) != nullptr; ++p)
      EXPECT_FALSE(p[1] >= '1' && p[1] <= '9') << "unsubstituted marker in " << text;
  }
  // The catalogue is beside the program or in KLP_CATALOG_DIR, never taken from the build tree.
  klptest::TmpDir tmp;
  std::string built = klptest::binPath("klpkccmd"), copy = tmp.path() + "klpkccmd";
  ASSERT_EQ(0, klptest::run({"/bin/cp", built, copy}).exitCode);
  const struct { std::string program; std::vector<std::string> env; bool found; } programs[] = {
      {built, {}, true}, {copy, {}, false}, {copy, {"KLP_CATALOG_DIR=" KLP_BIN_DIR}, true}};
  for (const auto& r : programs) {
    auto p = klptest::run({r.program}, r.env);
    EXPECT_EQ(12, p.exitCode);
    EXPECT_EQ(r.found, p.err.find("KLP0513E") == std::string::npos) << r.program << p.err;
  }
}

struct NamedCatalogLogger : msgLoggerU {
  explicit NamedCatalogLogger(const char* name) : msgLoggerU(MSG_APP_KLPKCCMD, 0) {
    snprintf(catalogName_, sizeof catalogName_, "%s", name);
  }
};
// Below 8000 the catalogue's text; without one KLP0513E once to stderr and log; blank thread: run-time's.
TEST_F(LoggerTest, LoggerUsesTheCatalogueAndFallsBack) {
  auto c = klptest::inChild(tmp.path(), [&] {
    msgSetThreadNameProvider([]() -> const char* { return "a-very-long-thread-name"; });
    for (const char* catalog : {"vdbklp.mo", "no-such-catalogue.mo"}) {
      NamedCatalogLogger cl(catalog);
      prepare(cl);
      for (int number : {506, 661}) cl.putKlpMsg(number, MSG_DEST_STDOUT, "o", " ", "Capture Commands");
    }
    return 0;
  });
  std::string head = "  \"KlpKCcmd\" : \"KLP\" : \"a-very-long-thr\" : ";
  const std::string want[] = {
      "KLP0506E" + head + "The program could not reach the \"Capture Commands\" queue of the "
      "server. The server is not running or its queue is not available.", "KLP0661E Job was cancelled",
      "KLP0553W" + head + "An internal error  \"4\" occurred for message number \"506\"",
      "KLP0661E Job was cancelled"};
  auto out = klptest::lines(c.out);
  ASSERT_EQ(std::size(want), out.size()) << c.out;
  for (size_t i = 0; i < out.size(); ++i) EXPECT_EQ(27u, out[i].find(want[i])) << out[i];
  EXPECT_EQ(27u, c.err.find("KLP0513E \"KlpKCcmd\":\"KLP\" : \" \": The program could not open the "
                            "message file named 'no-such-catalogue.mo', Reason: CATALOG:  2")) << c.err;
  EXPECT_EQ(1u, klptest::lines(c.err).size());
  std::string log = klptest::readFile(tmp.path() + "test.log");
  EXPECT_EQ(27u + 16u + 27u, log.find("KLP0513E")) << log;  // stamp, origin, the record's own stamp
  EXPECT_EQ(27u, log.find("<composeKlpMsg> ")) << log;
}

}  // namespace
