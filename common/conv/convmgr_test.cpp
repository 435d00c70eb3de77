// Code-page conversion: real data, output bounds, the value and running-buffer
// forms, CCSID attributes, the converter list and the end of the process state.
#include "common/conv/convmgr.h"

#include <gtest/gtest.h>
#include <unicode/ucnv.h>

#include <cstring>
#include <string>
#include <vector>

#include "common/env/klpenv.h"
#include "common/msg/msglogger.h"
#include "common/parms/klpparm.h"
#include "tests/testing/klptest.h"

namespace {

using Bytes = std::vector<uint8_t>;

std::string hex(const Bytes& b) {
  std::string s;
  for (uint8_t c : b) s += "0123456789ABCDEF"[c >> 4], s += "0123456789ABCDEF"[c & 15];
  return s;
}

Bytes managerOutput(ConvMgr& m, uint32_t from, uint32_t to, const Bytes& in, int graphic,
                    int* rc) {
  const char* s = reinterpret_cast<const char*>(in.data());
  char* out = nullptr;
  *rc = m.cpcv(from, &s, s + in.size(), to, &out, nullptr, 0, 1, 0, graphic, 0, 1, 1);
  if (*rc != 0) return {};
  int32_t n;
  memcpy(&n, out, 4);
  return Bytes(out + 4, out + 4 + n);
}

// True when ICU's converter of this name is the one of this CCSID.
bool icuNames(const char* name, uint32_t ccsid) {
  UErrorCode err = U_ZERO_ERROR;
  UConverter* c = ucnv_open(name, &err);
  bool same = U_SUCCESS(err) && !strcmp(ucnv_getName(c, &err), name) &&
              ucnv_getCCSID(c, &err) == static_cast<int32_t>(ccsid);
  ucnv_close(c);
  return same;
}

struct LogFile {
  klptest::TmpDir dir;
  klptest::ProcessLogger logger{MSG_APP_KLPKCCMD, dir.path(), "conv.log"};
  std::string text() const { return klptest::readFile(dir.path() + "conv.log"); }
};

}  // namespace

// Expected bytes: ICU's direct conversion of the same meaning.
TEST(ConvMgr, ConvertsRealData) {
  struct Row { const char* what; uint32_t from, to; Bytes in; int graphic; const char* want; };
  const Row rows[] = {
      {"EBCDIC 37 with accents", 37, 1208,
       {0xC8, 0x85, 0x93, 0x93, 0x96, 0x6B, 0x40, 0x63, 0xEC, 0xFC, 0x5A}, 0,
       "48656C6C6F2C20C384C396C39C21"},
      {"UTF-8 with a bad byte and a cut sequence", 1208, 37,
       {'G', 'r', 0xC3, 0xBC, 0xC3, 0x9F, 0xFF, 'e', 0xE2, 0x82}, 0, "C799DC593F853F"},
      {"930 mixed", 930, 1208, {0xC1, 0x0E, 0x42, 0xC1, 0x42, 0xC2, 0x0F, 0xF1}, 0,
       "41EFBCA1EFBCA231"},
      {"939 mixed, shift-out never closed", 939, 1208, {0x81, 0x0E, 0x42, 0xC1, 0x42}, 0,
       "61EFBCA11A"},
      {"939 shift-in without shift-out", 939, 1208, {0x81, 0x0F, 0x82}, 0, "6162"},
      {"933 broken: closed as if a shift-in ended it", 933, 1208, {0xC1, 0x0E, 0x42, 0xC1}, 0,
       "41EFBCA1"},
      {"930 graphic gets its shift bytes", 930, 1208, {0x42, 0xC1, 0x42, 0xC2}, 1, "EFBCA1EFBCA2"},
      {"UTF-8 to 939 adds shift bytes", 1208, 939, {'a', 0xEF, 0xBC, 0xA1, 'b'}, 0, "810E42C10F82"},
      {"UTF-16 to UTF-8", 1200, 1208, {'Z', 0, 0xFC, 0, 0xAC, 0x20, 0x3D, 0xD8, 0x00, 0xDE}, 0,
       "5AC3BCE282ACF09F9880"},
      {"EBCDIC 37 to UTF-16", 37, 1200, {0xC1, 0x63, 0x40}, 0, "4100C4002000"},
      {"UTF-8 to 933", 1208, 933, {'k', 0xEA, 0xB0, 0x80, 'x'}, 0, "920E88610FA7"},
      // Three bytes per two source bytes, EBCDIC blanks as pads (37 has no
      // full-width letters: two substitution bytes).
      {"graphic 834 padded", 834, 37, {0x42, 0xC1, 0x42, 0xC2}, 1, "3F3F40404040"},
  };
  LogFile log;
  ConvMgr m(4);
  for (const Row& r : rows) {
    int rc = -1;
    EXPECT_EQ(hex(managerOutput(m, r.from, r.to, r.in, r.graphic, &rc)), r.want) << r.what;
    EXPECT_EQ(rc, 0) << r.what;
  }
}

TEST(ConvMgr, FaultsAnswerCodesAndNeverWritePastTheBuffer) {
  struct Row {  // logged: a text the log must hold ("" none)
    const char* what; uint32_t from, to; Bytes in; size_t room; int rc; const char* logged;
  };
  const Row rows[] = {
      {"output too small", 37, 1208, {0xC1, 0xC2, 0xC3, 0xC4, 0xC5, 0xC6}, 4, 5003, ""},
      {"UTF-16 output too small", 37, 1200, {0xC1, 0xC2, 0xC3}, 5, 5003, ""},
      {"UTF-16 copy too small", 1200, 13488, {'a', 0, 'b', 0, 'c', 0}, 5, 5003, ""},
      {"half a UTF-16 unit", 1200, 1208, {'a', 0, 'b'}, 16, 5001, "ucnv_fromUnicode"},
      {"unknown source CCSID", 12345, 1208, {'a'}, 16, 5000, "U_FILE_ACCESS_ERROR"},
      {"unknown target CCSID", 37, 65535, {0xC1}, 16, 5000, "targ converter"},
      {"empty input", 37, 1208, {}, 0, 0, ""},
  };
  for (const Row& r : rows) {
    LogFile log;
    ConvMgr m(0);
    std::vector<char> buf(r.room + 8, '#');
    const char* s = reinterpret_cast<const char*>(r.in.data());
    char* t = buf.data();
    int rc = m.cpcv(r.from, &s, s + r.in.size(), r.to, &t, buf.data() + r.room, 0, 0, 0, 0, 0, 1, 1);
    EXPECT_EQ(rc, r.rc) << r.what;
    EXPECT_EQ(std::string(buf.data() + r.room, 8), "########") << r.what;
    EXPECT_NE(log.text().find(r.logged), std::string::npos) << r.what << "\n" << log.text();
    if (r.rc == 0 || r.rc == 5003) continue;
    // A manager-allocated output of a failed conversion is withdrawn (619).
    s = reinterpret_cast<const char*>(r.in.data());
    char* none = nullptr;
    EXPECT_EQ(m.cpcv(r.from, &s, s + r.in.size(), r.to, &none, nullptr, 0, 0, 0, 0, 0, 1, 1), r.rc);
    EXPECT_EQ(none, nullptr) << r.what;
    EXPECT_NE(log.text().find("KLP0619E"), std::string::npos) << r.what;
  }
}

TEST(ConvMgr, ValuesAndRunningBuffers) {
  LogFile log;
  ConvMgr m(2);
  char buf[8];
  char* t = buf;
  int16_t len = sizeof buf;
  // Equal single-byte CCSIDs: copied unchanged, or handed back as they are.
  EXPECT_EQ(m.cpcvc(37, "\xC1\xC2\xC3", 37, &len, &t, -1, 0, 0, 0), 0);
  EXPECT_EQ(len, 3);
  EXPECT_STREQ(buf, "\xC1\xC2\xC3");
  const char* value = "\xC1\xC2";
  char* none = nullptr;
  EXPECT_EQ(m.cpcvc(37, value, 37, &len, &none, 2, 0, 0, 0), 0);
  EXPECT_EQ(none, value);
  EXPECT_EQ(len, 2);
  len = 4;
  EXPECT_EQ(m.cpcvc(37, "ABCDEFGH", 37, &len, &t, 8, 0, 0, 0), 5003);
  EXPECT_EQ(len, 4);
  // Manager output, halved to count double-byte characters.
  none = nullptr;
  EXPECT_EQ(m.cpcvc(1208, "abc", 1200, &len, &none, 3, 0, 0, 1), 0);
  EXPECT_EQ(len, 3);
  EXPECT_EQ(std::string(none, 6), std::string("a\0b\0c\0", 6));
  int32_t len32 = 0;
  none = nullptr;
  EXPECT_EQ(m.cpcvl(37, "\xC1\xC2", 1208, &len32, &none, 2, 0, 0, 0), 0);
  EXPECT_EQ(std::string(none, len32), "AB");
  // Lengths that a 16-bit field cannot hold.
  std::string big(20000, '\x63');  // a-umlaut: two bytes each in UTF-8
  none = nullptr;
  EXPECT_EQ(m.cpcvc(37, big.c_str(), 1208, &len, &none, 20000, 0, 0, 0), 5003);
  EXPECT_EQ(none, nullptr);
  big.resize(40000, '\xC1');
  EXPECT_EQ(m.cpcvc(37, big.c_str(), 37, &len, &none, 40000, 0, 0, 0), 5003);
  // Graphic lengths count double-byte characters.
  len = sizeof buf;
  EXPECT_EQ(m.cpcvc(930, "\x42\xC1", 1208, &len, &t, 1, 0, 1, 0), 0);
  EXPECT_EQ(std::string(buf, len), "\xEF\xBC\xA1");

  struct Row { const char* in; int32_t remaining; int rc; int32_t left; const char* out; };
  const Row rows[] = {
      {"\xC1\xC2", 3, 6024, 3, ""},       // fewer than length + 2 left
      {"\xC1\xC2", -1, 6024, -1, ""},     // a negative count
      {"\x63\x63\x63", 5, 6024, 5, ""},  // fits the check, not the output: cut inside a character
      {"", 2, 0, 2, ""},
      {"\xC1\xC2", 4, 0, 2, "AB"},        // nothing of the cut value is left over
  };
  for (const Row& r : rows) {
    char area[16];
    memset(area, '#', sizeof area);
    ConvRunBuf rb{area, 1, r.remaining};
    EXPECT_EQ(m.cpcvb(37, 1208, r.in, static_cast<int32_t>(strlen(r.in)), &rb, 0), r.rc) << r.in;
    EXPECT_EQ(std::string(area + 1, rb.used - 1), r.out) << r.in;
    EXPECT_EQ(rb.remaining, r.left);
    EXPECT_EQ(std::string(area + 1 + r.remaining + (r.remaining < 0 ? 1 : 0), 2), "##");
  }
  // Only the converted value that did not fit was reported.
  std::string text = log.text();
  EXPECT_NE(text.find("\"ConvMgr::cpcvc\" a step failed with return code \"5003\": \"do conversion\""),
            std::string::npos) << text;
  EXPECT_EQ(text.find("KLP0589E"), text.rfind("KLP0589E")) << text;
}

TEST(ConvMgr, CcsidAttributes) {
  struct Row { uint32_t ccsid; int rc; uint32_t character, companion; };
  const Row rows[] = {
      {941, 823, 0, 941},       {943, 0, 943, 941},     {1140, 0, 37, 37},
      {12345, 0, 12345, 12345}, {0, 0, 0, 0},           {1252, 0, 5348, 1200},
      {834, 823, 0, 933},       {4396, 823, 0, 300},    {13490, 823, 0, 1200},
      {65535, 0, 0, 1200},      {933, 0, 933, 933},     {37, 0, 37, 1200},
      {62251, 0, 425, 425},     {17586, 0, 13490, 13490}, {954, 0, 954, 13488},
  };
  for (const Row& r : rows) {
    uint32_t c = 99, k = 99;
    const char* name = nullptr;
    EXPECT_EQ(getCcsidInfo(r.ccsid, &c, &k, &name), r.rc) << r.ccsid;
    EXPECT_EQ(c, r.character) << r.ccsid;
    EXPECT_EQ(k, r.companion) << r.ccsid;
  }
  // Names: ICU's own for the EBCDIC pages and UTF-8, otherwise "unknown".
  for (uint32_t ccsid : {37u, 500u, 1047u, 1208u, 930u}) {
    const char* name = nullptr;
    getCcsidInfo(ccsid, nullptr, nullptr, &name);
    EXPECT_TRUE(ccsid == 930 ? !strcmp(name, "unknown") : icuNames(name, ccsid)) << ccsid << name;
  }
}

TEST(ConvMgr, ListNamesAndTheEndOfTheProcessState) {
  LogFile log;
  ConvMgr m(1);
  char buf[64];
  m.printList(buf, sizeof buf);
  EXPECT_STREQ(buf, "No converters in the list.\n\n");
  const char* name = nullptr;
  ASSERT_EQ(m.getName(37, &name, 0), 0);
  EXPECT_TRUE(icuNames(name, 37)) << name;
  ASSERT_EQ(m.getName(1208, &name, 0), 0);
  m.printList(buf, sizeof buf);
  EXPECT_STREQ(buf, "List: 37 1208 \n");
  m.printList(buf, 12);
  EXPECT_STREQ(buf, "List: \n");

  // After cleanup nothing converts, not even through clones made before.
  klptest::TmpDir dir;
  auto c = klptest::inChild(dir.path(), [] {
    klptest::ProcessLogger logger;
    ConvMgr before(2);
    ConvListItem* item = nullptr;
    if (before.lookupAddConv(37, &item, 0) != 0 || before.lookupAddConv(1208, &item, 0) != 0)
      return 1;
    ConvMgr::cleanup();
    const char* s = "\xC1";
    char* out = nullptr;
    int rc = before.cpcv(37, &s, s + 1, 1208, &out, nullptr, 0, 0, 0, 0, 0, 1, 1);
    return rc == 1000 && out == nullptr ? 0 : 2;
  });
  EXPECT_EQ(c.exitCode, 0) << c.out << c.err;
  EXPECT_NE(c.out.find("static ConvMgr not initialized"), std::string::npos) << c.out;
}

TEST(ConvMgr, ApplyServerDecidesAboutErrorsItself) {
  klptest::TmpDir dir;
  auto c = klptest::inChild(dir.path(), [] {
    klptest::ProcessLogger logger;
    // The apply server's parameters: DEBUG (1) and the strict switch (39).
    ParmEntry table[40];
    char names[40][8];
    for (int i = 0; i < 40; ++i) {
      snprintf(names[i], sizeof names[i], "P%d", i);
      table[i] = makeParmEntry(i, names[i], 0, PARM_BOOLEAN, -1, -1, -1, nullptr, 1, 1, 0);
    }
    int rc = 0;
    klpParmClass parms(table, 40, &rc);
    klpSetCurrentParms(&parms);
    setEnvTovRIB(klpGetEnv(), "xqapply", 1, 0, 0);
    ConvMgr m(2);
    const char euro[] = "\xE2\x82\xAC";  // not in CCSID 37
    const char* s = euro;
    char* out = nullptr;
    if (m.cpcv(1208, &s, euro + 3, 37, &out, nullptr, 0, 0, 0, 0, 0, 1, 1) != 5001) return 1;
    const char broken[] = "\xC1\x0E\x42\xC1";
    s = broken;
    return m.cpcv(933, &s, broken + 4, 1208, &out, nullptr, 0, 0, 0, 0, 0, 1, 1);
  });
  EXPECT_EQ(c.exitCode, 0) << c.out;
  EXPECT_NE(c.out.find("KOR: Data after adding SHIFT bytes (5): C10E42C10F\n"), std::string::npos)
      << c.out;
  for (const char* silent : {"KLP0568E", "KLP0589E", "KLP0619E"})
    EXPECT_EQ(c.out.find(silent), std::string::npos) << c.out;
}
