// What the product knows about each CCSID: its character and companion
// CCSIDs, and which ones are pure double-byte.
#include <unicode/ucnv.h>

#include <cstddef>
#include <cstdio>
#include <cstdint>

#include "common/conv/convmgr.h"

namespace {

// Single-byte code pages: themselves, with UTF-16 as companion.
const uint16_t kSingleByte[] = {
    37,   273,  274,  277,  278,  280,  284,  285,  290,  297,  367,  420,  423,  424,  425,
    437,  500,  737,  803,  806,  813,  819,  833,  836,  838,  850,  852,  855,  856,  857,
    860,  862,  863,  864,  865,  866,  869,  870,  871,  874,  875,  878,  897,  912,  915,
    916,  920,  921,  922,  923,  924,  1008, 1025, 1026, 1027, 1040, 1041, 1042, 1046, 1047,
    1051, 1089, 1112, 1114, 1122, 1123, 1124, 1125, 1126, 1129, 1130, 1131, 1137, 1167, 1168,
    1208, 1232, 1234, 1250, 1251, 1253, 1254, 1255, 1256, 1257, 1258, 1275, 1280, 1281, 1282,
    1283, 1394, 4369, 5488, 8612};

// Pure double-byte code pages: no character CCSID, themselves as companion.
const uint16_t kDoubleByte[] = {300, 301, 835, 837, 891, 895, 926,  927,  928,  941, 947,
                                951, 971, 1043, 1115, 1351, 1362, 1380, 1382, 1385, 1393};

struct Pair {
  uint32_t ccsid;
  uint32_t other;
};

// Mixed code pages: themselves, with their double-byte part as companion.
const Pair kMixed[] = {
    {934, 926},    {936, 928},    {937, 835},   {942, 301},   {943, 941},   {944, 926},
    {946, 928},    {948, 927},    {949, 951},   {950, 947},   {954, 13488}, {964, 13488},
    {970, 971},    {1363, 1362},  {1364, 834},  {1381, 1380}, {1383, 1382}, {1386, 1385},
    {1388, 837},   {1390, 300},   {1399, 300},  {5039, 1351}, {933, 933},   {5348, 5348}};

// CCSIDs replaced by another for both answers.
const Pair kReplaced[] = {
    {808, 866},     {848, 1125},    {849, 1131},    {858, 850},     {867, 862},
    {872, 855},     {901, 921},     {902, 922},     {903, 1042},    {904, 1043},
    {930, 1390},    {932, 942},     {935, 1388},    {938, 948},     {939, 1399},
    {1004, 1252},   {1140, 37},     {1141, 273},    {1142, 277},    {1143, 278},
    {1144, 280},    {1145, 284},    {1146, 285},    {1147, 297},    {1148, 500},
    {1149, 871},    {1153, 870},    {1154, 1025},   {1155, 1026},   {1156, 1112},
    {1157, 1122},   {1158, 1123},   {1159, 37},     {1160, 838},    {1161, 874},
    {1162, 874},    {1163, 1129},   {1164, 1130},   {1370, 950},    {1371, 937},
    {1392, 5488},   {4899, 803},    {4909, 813},    {4930, 834},    {4933, 837},
    {4971, 875},    {5026, 1390},   {5035, 1399},   {5104, 1008},   {5123, 1027},
    {5210, 1114},   {5222, 1126},   {5346, 1250},   {5347, 1251},   {5349, 1253},
    {5350, 1254},   {5351, 1255},   {5352, 1256},   {5353, 1257},   {5354, 1258},
    {8482, 290},    {8616, 424},    {9027, 835},    {9044, 852},    {9048, 856},
    {9049, 857},    {9061, 869},    {9238, 1046},   {12708, 420},   {12712, 424},
    {13121, 833},   {13124, 836},   {16684, 300},   {16804, 420},   {17248, 864},
    {17584, 13488}, {17586, 13490}, {21427, 947},   {28709, 37},    {62208, 856},
    {62209, 862},   {62210, 916},   {62211, 424},   {62212, 862},   {62213, 862},
    {62214, 862},   {62215, 1255},  {62216, 862},   {62217, 862},   {62218, 864},
    {62219, 862},   {62220, 856},   {62221, 862},   {62222, 916},   {62223, 1255},
    {62224, 420},   {62225, 864},   {62226, 1046},  {62227, 1089},  {62228, 1256},
    {62229, 424},   {62230, 856},   {62231, 862},   {62232, 916},   {62233, 420},
    {62234, 420},   {62235, 424},   {62236, 856},   {62237, 1255},  {62238, 916},
    {62239, 1255},  {62240, 424},   {62241, 856},   {62242, 862},   {62243, 916},
    {62244, 1255},  {62245, 424},   {62246, 1046},  {62247, 1046},  {62248, 1046},
    {62249, 1046},  {62250, 420},   {62251, 425}};

template <size_t N>
bool inList(const uint16_t (&list)[N], uint32_t ccsid) {
  for (uint16_t c : list)
    if (c == ccsid) return true;
  return false;
}

template <size_t N>
const Pair* findPair(const Pair (&list)[N], uint32_t ccsid) {
  for (const Pair& p : list)
    if (p.ccsid == ccsid) return &p;
  return nullptr;
}

// ICU's own name of the table for a CCSID, kept for the process: ICU's
// alias data may be released by a cleanup of the conversion manager.
const char* icuTableName(const char* alias, char (&keep)[48]) {
  UErrorCode err = U_ZERO_ERROR;
  const char* n = ucnv_getAlias(alias, 0, &err);
  snprintf(keep, sizeof keep, "%s", U_SUCCESS(err) && n ? n : "unknown");
  return keep;
}

const char* converterName(uint32_t ccsid) {
  static char n37[48], n500[48], n1047[48];
  switch (ccsid) {
    case 37: { static const char* n = icuTableName("cp037", n37); return n; }
    case 500: { static const char* n = icuTableName("cp500", n500); return n; }
    case 1047: { static const char* n = icuTableName("cp1047", n1047); return n; }
    case 1208: return "UTF-8";
    default: return "unknown";
  }
}

}  // namespace

int getCcsidInfo(uint32_t ccsid, uint32_t* charCcsid, uint32_t* companion, const char** name) {
  uint32_t c = ccsid, k = ccsid;
  int rc = 0;
  const Pair* p = nullptr;
  if (ccsid == 0) {
    c = k = 0;
  } else if (ccsid == 1252) {
    c = 5348;
    k = 1200;
  } else if (inList(kSingleByte, ccsid)) {
    k = 1200;
  } else if (inList(kDoubleByte, ccsid)) {
    c = 0;
    rc = CONV_RC_DBCS_ONLY;
  } else if (ccsid == 834 || ccsid == 4396 || ccsid == 1200 || ccsid == 1202 ||
             ccsid == 13488 || ccsid == 13490 || ccsid == 65535) {
    c = 0;
    k = ccsid == 834 ? 933 : ccsid == 4396 ? 300 : 1200;
    rc = ccsid == 65535 ? 0 : CONV_RC_DBCS_ONLY;
  } else if ((p = findPair(kMixed, ccsid))) {
    k = p->other;
  } else if ((p = findPair(kReplaced, ccsid))) {
    c = k = p->other;
  }
  if (charCcsid) *charCcsid = c;
  if (companion) *companion = k;
  if (name) *name = converterName(ccsid);
  return rc;
}
