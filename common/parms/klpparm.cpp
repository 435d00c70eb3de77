// The parameter registry: construction from a table, typed setters and
// getters with their source priority, and the process's current registry.
#include "common/parms/klpparm.h"

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "common/msg/klplog.h"
#include "common/msg/msglogger.h"
#include "common/parms/parmutil.h"
#include "common/util/klprc.h"

char klpEmptyText[1] = {0};

namespace {

const char kOriginSetParm[] = "klpParmClass:setParm";      // INTEGER, BOOLEAN, COMMAND
const char kOriginSetParmStr[] = "klpParmClass::setParm";  // STRING
const char kOriginSetBool[] = "klpParmClass:setBool";

klpParmClass* gCurrentParms = nullptr;

// The logger asks for string parameters by number; answer quietly (no
// out-of-range or type lines) since it may ask for anything.
const char* currentStringParm(int index) {
  const ParmEntry* s = gCurrentParms ? gCurrentParms->peekSlot(index) : nullptr;
  if (!s || s->type != PARM_STRING) return nullptr;
  return s->strValue;
}

void releaseText(char*& text) {
  if (text && text != klpEmptyText) free(text);
  text = klpEmptyText;
}

// A heap copy of text; the shared empty text when out of memory, so that a
// slot never holds a null string.
char* copyText(const char* text) {
  char* c = strdup(text);
  return c ? c : klpEmptyText;
}

void placeholder(ParmEntry& e) {
  memset(&e, 0, sizeof e);
  e.index = -1;
  strcpy(e.name, "KLPPLACEHOLDER");
  e.matchLength = 8;
  e.type = PARM_PLACEHOLDER;
  e.minimum = e.maximum = e.intValue = -1;
  e.strValue = nullptr;
}

// A refused value: one from the control table names the table (541), one
// from any other source gets `message`.
int refuseValue(int message, const char* origin, const char* value, const char* name,
                int32_t source, const char* tableName) {
  if (source == PARM_SRC_TABLE)
    logKlpMsg(541, origin, KLP_DEST_CONSOLE, value, nullptr, 2, name, tableName);
  else
    logKlpMsg(message, origin, KLP_DEST_CONSOLE, value, nullptr, 1, name);
  return KLP_RC_BAD_PARM;
}

}  // namespace

ParmEntry makeParmEntry(int32_t index, const char* name, int32_t matchLength, int32_t type,
                        int32_t minimum, int32_t maximum, int32_t intValue,
                        const char* strValue, int32_t boolValue, int32_t display,
                        int32_t changeable) {
  ParmEntry e;
  memset(&e, 0, sizeof e);
  e.index = index;
  if (name) memcpy(e.name, name, strnlen(name, sizeof e.name));
  e.matchLength = matchLength;
  e.type = type;
  e.minimum = minimum;
  e.maximum = maximum;
  e.intValue = intValue;
  e.strValue = const_cast<char*>(strValue);  // read only by the constructor
  e.boolValue = boolValue;
  e.source = PARM_SRC_DEFAULT;
  e.display = display;
  e.changeable = changeable;
  return e;
}

const char* parmSourceLabel(int32_t source, const char* tableName) {
  switch (source) {
    case PARM_SRC_DEFAULT: return "DEFAULT";
    case PARM_SRC_TABLE: return tableName ? tableName : "PARAMETERS TABLE";
    case PARM_SRC_COMMANDLINE: return "COMMANDLINE";
    case PARM_SRC_CHGPARMS: return "CHGPARMS COMMAND";
    case PARM_SRC_SYSTEM: return "SYSTEM OVERRIDE";
    case PARM_SRC_KAPPLY: return "K APPLY OVERRIDE";
    default: return "UNKNOWN";
  }
}

klpParmClass::klpParmClass(const ParmEntry* table, int n, int* rc) {
  int result = 0;
  setTableName("PARAMETERS TABLE");
  // Every slot starts as a placeholder, also when the table is refused as a
  // whole, so that the destructor always sees initialised slots.
  for (auto& s : slots_) placeholder(s);

  if (n >= KLP_PARM_SLOTS + 1 || n < 0) {
    printf("klpParmClass: Error: parameter count (%d) is out of ", n);
    printf("range (0-%d).\n", KLP_PARM_SLOTS);
    if (rc) *rc = result;
    return;
  }
  count_ = n;
  if (!table) n = 0;

  for (int i = 0; i < n; ++i) {
    const ParmEntry& t = table[i];
    size_t nameLen = strnlen(t.name, sizeof t.name);
    // An index equal to the count is taken (one past the last), but never
    // one beyond the 64 slots that exist.
    if (t.index > n || t.index < 0 || t.index >= KLP_PARM_SLOTS) {
      printf("klpParmClass: Error: parameter index (%d) for ", t.index);
      printf("parameter %.*s is out of range (0-%d).\n", static_cast<int>(nameLen), t.name, n);
      result = KLP_RC_BAD_PARM;
      continue;
    }
    if (nameLen > KLP_PARM_NAME_MAX) {
      printf("klpParmClass: Error: length of parameter name %.*s is ", static_cast<int>(nameLen),
             t.name);
      printf("greater than max (%d).\n", KLP_PARM_NAME_MAX);
      result = KLP_RC_BAD_PARM;
      continue;
    }
    if (t.type == PARM_INTEGER && (t.intValue < t.minimum || t.intValue > t.maximum)) {
      printf("klpParmClass: Error: default value (%d) for ", t.intValue);
      printf("parameter %s is out of range (%d-%d)\n", t.name, t.minimum, t.maximum);
      result = KLP_RC_BAD_PARM;
      continue;
    }
    ParmEntry& s = slots_[t.index];
    // A second entry for the same index replaces the first; drop its text.
    if ((s.type == PARM_STRING || s.type == PARM_COMMAND) && s.strValue) releaseText(s.strValue);
    s = t;
    if (s.matchLength < 1) s.matchLength = static_cast<int32_t>(nameLen);
    if (t.type != PARM_STRING && t.type != PARM_COMMAND) {
      s.strValue = klpEmptyText;
    } else if (!t.strValue || t.strValue[0] == '\0') {
      s.strValue = klpEmptyText;
    } else if (strlen(t.strValue) <= KLP_PARM_VALUE_MAX) {
      s.strValue = copyText(t.strValue);
    } else {
      printf("klpParmClass: Error: length of parameter value ");
      printf("%s for parameter %s is greater than max (%d)\n", t.strValue, t.name,
             KLP_PARM_VALUE_MAX);
      result = KLP_RC_BAD_PARM;
      placeholder(s);
    }
  }
  if (rc) *rc = result;
}

klpParmClass::~klpParmClass() {
  if (gCurrentParms == this) klpSetCurrentParms(nullptr);
  // COMMAND texts are released too: nothing reads them once the registry is
  // gone, and keeping them would only leak.
  for (auto& s : slots_) {
    if ((s.type == PARM_STRING || s.type == PARM_COMMAND) && s.strValue) releaseText(s.strValue);
  }
}

void klpParmClass::setTableName(const char* name) {
  snprintf(tableName_, sizeof tableName_, "%s", name ? name : "");
}

bool klpParmClass::indexOk(int index) const {
  if (index < 0 || index >= count_) {
    printf("Parameter index %d is out of range.\n", index);
    return false;
  }
  return true;
}

void klpParmClass::mirrorLogStdout(int index, int32_t value) const {
  if (index != PARM_IDX_LOGSTDOUT) return;
  if (msgLogger* logger = klpGetProcessLogger()) logger->setConsoleFlag(value ? 1 : 0);
}

int klpParmClass::setParm(int index, int32_t value, int32_t source) {
  if (!indexOk(index)) return KLP_RC_BAD_PARM;
  ParmEntry& s = slots_[index];
  char num[16];
  snprintf(num, sizeof num, "%d", value);
  if (s.type != PARM_INTEGER) {
    logKlpMsg(501, kOriginSetParm, KLP_DEST_CONSOLE, num, nullptr, 1, s.name);
    return KLP_RC_BAD_PARM;
  }
  if (value < s.minimum || value > s.maximum) {
    return refuseValue(503, kOriginSetParm, num, s.name, source, tableName_);
  }
  if (source >= s.source) {
    s.intValue = value;
    s.source = source;
  }
  return KLP_OK;
}

int klpParmClass::setParmBool(int index, int32_t value, int32_t source) {
  if (!indexOk(index)) return KLP_RC_BAD_PARM;
  ParmEntry& s = slots_[index];
  if (s.type != PARM_BOOLEAN) {
    logKlpMsg(501, kOriginSetParm, KLP_DEST_CONSOLE, value == 1 ? "Y" : "N", nullptr, 1, s.name);
    return KLP_RC_BAD_PARM;
  }
  if (source >= s.source) {
    s.boolValue = value ? 1 : 0;
    s.source = source;
    mirrorLogStdout(index, s.boolValue);
  }
  return KLP_OK;
}

int klpParmClass::setBool(int index, char yesNo, int32_t source) {
  if (!indexOk(index)) return KLP_RC_BAD_PARM;
  ParmEntry& s = slots_[index];
  char text[2] = {yesNo, '\0'};
  if (s.type != PARM_BOOLEAN) {
    logKlpMsg(501, kOriginSetBool, KLP_DEST_CONSOLE, text, nullptr, 1, s.name);
    return KLP_RC_BAD_PARM;
  }
  int32_t value;
  if (yesNo == 'Y' || yesNo == 'y') {
    value = 1;
  } else if (yesNo == 'N' || yesNo == 'n') {
    value = 0;
  } else {
    return refuseValue(500, kOriginSetBool, text, s.name, source, tableName_);
  }
  if (source >= s.source) {
    s.boolValue = value;
    s.source = source;
    mirrorLogStdout(index, value);
  }
  return KLP_OK;
}

int klpParmClass::setParm(int index, const char* text, int32_t source) {
  if (!indexOk(index)) return KLP_RC_BAD_PARM;
  ParmEntry& s = slots_[index];
  if (!text) text = klpEmptyText;
  if (s.type != PARM_STRING) {
    logKlpMsg(501, kOriginSetParmStr, KLP_DEST_SEVERITY, text, nullptr, 1, s.name);
    return KLP_RC_BAD_PARM;
  }
  size_t len = strlen(text);
  // Quotes around a value keep it as typed; they do not count to the limit.
  size_t effective = len;
  if (len >= 2 && text[0] == '"' && text[len - 1] == '"') effective = len - 2;
  if (effective > static_cast<size_t>(s.maximum < 0 ? 0 : s.maximum)) {
    char effText[24], maxText[16];
    snprintf(effText, sizeof effText, "%zu", effective);
    snprintf(maxText, sizeof maxText, "%d", s.maximum);
    logKlpMsg(502, kOriginSetParmStr, KLP_DEST_SEVERITY, text, nullptr, 3, effText, s.name,
              maxText);
    return KLP_RC_BAD_PARM;
  }
  if (source >= s.source) {
    // Copy before releasing: the text may be the slot's own value.
    char* fresh = effective != 0 ? copyText(text) : klpEmptyText;
    releaseText(s.strValue);
    s.strValue = fresh;
    if (effective != 0) s.source = source;
  }
  return KLP_OK;
}

int klpParmClass::setCommand(int index, int32_t flag, const char* text, int32_t source) {
  if (!indexOk(index)) return KLP_RC_BAD_PARM;
  ParmEntry& s = slots_[index];
  if (!text) text = klpEmptyText;
  if (s.type != PARM_COMMAND) {
    logKlpMsg(501, kOriginSetParm, KLP_DEST_CONSOLE, text, nullptr, 1, s.name);
    return KLP_RC_BAD_PARM;
  }
  size_t len = strlen(text);
  if (len > KLP_PARM_VALUE_MAX) {
    char lenText[24];
    snprintf(lenText, sizeof lenText, "%zu", len);
    logKlpMsg(502, kOriginSetParm, KLP_DEST_CONSOLE, text, nullptr, 3, lenText, s.name, "1040");
    return KLP_RC_BAD_PARM;
  }
  // A command is set whatever the priority: it is what the user asked now.
  char* fresh = len ? copyText(text) : klpEmptyText;
  releaseText(s.strValue);
  s.strValue = fresh;
  if (len) s.source = source;
  s.boolValue = flag;
  mirrorLogStdout(index, flag);
  return KLP_OK;
}

int klpParmClass::setParmValue(int index, const char* text, int32_t source) {
  if (!indexOk(index)) return KLP_RC_BAD_PARM;
  if (!text) text = klpEmptyText;
  const ParmEntry& s = slots_[index];
  if (!isValidValue(index, text)) {
    logKlpMsg(500, kOriginSetParm, KLP_DEST_CONSOLE, text, nullptr, 1, s.name);
    return KLP_RC_BAD_PARM;
  }
  switch (s.type) {
    case PARM_INTEGER: return setParm(index, static_cast<int32_t>(strtol(text, nullptr, 10)), source);
    case PARM_BOOLEAN: {
      const char* p = text;
      while (*p == ' ' || *p == '\t') ++p;
      return setParmBool(index, (*p == 'Y' || *p == 'y') ? 1 : 0, source);
    }
    default: return setParm(index, text, source);
  }
}

int32_t klpParmClass::getParmInt(int index) const {
  if (!indexOk(index)) return -1;
  if (slots_[index].type != PARM_INTEGER) {
    printf("Parameter index %d is not of type INTEGER.\n", index);
    return -1;
  }
  return slots_[index].intValue;
}

int32_t klpParmClass::getParmBool(int index) const {
  if (!indexOk(index)) return 0;
  if (slots_[index].type != PARM_BOOLEAN) {
    printf("Parameter index %d is not of type BOOLEAN.\n", index);
    return 0;
  }
  return slots_[index].boolValue;
}

const char* klpParmClass::getParmString(int index) const {
  if (!indexOk(index)) return nullptr;
  if (slots_[index].type != PARM_STRING) {
    printf("Parameter index %d is not of type STRING.\n", index);
    return nullptr;
  }
  return slots_[index].strValue;
}

int32_t klpParmClass::getParmType(int index) const {
  if (!indexOk(index)) return -1;
  return slots_[index].type;
}

int32_t klpParmClass::getParmSource(int index) const {
  if (!indexOk(index)) return -1;
  return slots_[index].source;
}

const char* klpParmClass::getParmName(int index) const {
  if (!indexOk(index)) return nullptr;
  return slots_[index].name;
}

int klpParmClass::getNamedCommand() const {
  int found = -1;
  for (int i = 0; i < count_; ++i)
    if (slots_[i].type == PARM_COMMAND && slots_[i].boolValue == 1) found = i;
  return found;
}

const char* klpParmClass::getCommandText(int index) const {
  if (!indexOk(index)) return nullptr;
  if (slots_[index].type != PARM_COMMAND) return nullptr;
  return slots_[index].strValue ? slots_[index].strValue : klpEmptyText;
}

bool klpParmClass::isValidValue(int index, const char* text) const {
  if (!indexOk(index)) return false;
  if (!text) text = klpEmptyText;
  if (strlen(text) > KLP_PARM_VALUE_MAX) return false;
  const ParmEntry& s = slots_[index];
  switch (s.type) {
    case PARM_BOOLEAN: {
      char up[4] = {0};
      size_t n = strlen(text);
      if (n == 0 || n > 3) return false;
      for (size_t i = 0; i < n; ++i) up[i] = parmUpper(text[i]);
      return !strcmp(up, "Y") || !strcmp(up, "YES") || !strcmp(up, "N") || !strcmp(up, "NO");
    }
    case PARM_INTEGER: {
      int32_t v;
      if (parseDecimal(text, &v) != PARM_NUM_OK) return false;
      return v >= s.minimum && v <= s.maximum;
    }
    case PARM_STRING: return true;
    default: return false;
  }
}

int klpParmClass::findSlot(const char* kw, size_t kwLen, bool anyType) const {
  for (int i = 0; i < KLP_PARM_SLOTS; ++i) {
    const ParmEntry& s = slots_[i];
    if (s.matchLength < 1) continue;
    size_t n = static_cast<size_t>(s.matchLength);
    size_t nameLen = strlen(s.name);
    if (n > kwLen) continue;
    if (n == nameLen && n != kwLen) continue;
    if (n > nameLen) continue;  // cannot match beyond the name
    if (strncmp(kw, s.name, n) != 0) continue;
    if (!anyType && s.type != PARM_BOOLEAN && s.type != PARM_COMMAND) continue;
    return i;
  }
  return -1;
}

int klpParmClass::findChangeableParm(const char* keyword) {
  if (!keyword) return -1;
  char kw[KLP_PARM_NAME_MAX + 1];
  size_t len = 0;
  if (!upperKeyword(keyword, kw, &len)) return -1;
  if (!strncmp(kw, "KLPPLACEHOLDER", 14)) return -1;
  int i = findSlot(kw, len, true);
  if (i < 0 || slots_[i].index == -1 || !slots_[i].changeable) return -1;
  return slots_[i].index;
}

// Records are never freed, so those in use are chg_[0..chgCount_-1] and the
// rest are never touched: 64 kilobyte-sized records would cost a short-lived
// program a page fault every four of them just to mark them free.
const ChgParmsEntry* klpParmClass::getChgParmsEntry(int i) const {
  static const ChgParmsEntry kFree = {-1, ""};
  if (i < 0 || i >= KLP_PARM_SLOTS) return nullptr;
  return i < chgCount_ ? &chg_[i] : &kFree;
}

int klpParmClass::addChgParm(int index, const char* value) {
  if (!value) value = klpEmptyText;
  if (index < 0 || strlen(value) >= sizeof chg_[0].value) return KLP_RC_BAD_PARM;
  ChgParmsEntry* target = nullptr;
  for (int i = 0; i < chgCount_ && !target; ++i)
    if (chg_[i].index == index) target = &chg_[i];
  if (!target) {
    if (chgCount_ >= KLP_PARM_SLOTS) {
      printf("cmdParmsClass ERROR: no find room in chgparms array\n");
      return KLP_RC_BAD_PARM;
    }
    target = &chg_[chgCount_++];
    target->index = index;
  }
  snprintf(target->value, sizeof target->value, "%s", value);
  return KLP_OK;
}

klpParmClass* klpGetCurrentParms() { return gCurrentParms; }

void klpSetCurrentParms(klpParmClass* parms) {
  gCurrentParms = parms;
  msgSetStringParmProvider(parms ? currentStringParm : nullptr);
}
