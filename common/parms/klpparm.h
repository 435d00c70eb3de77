// The table-driven parameter registry shared by every program of the
// product. A program describes its parameters in a compiled-in table of
// ParmEntry records; the registry copies it into numbered slots, keeps each
// value with the source it came from, and lets later sources override earlier
// ones by a fixed priority. Other modules read parameters by number through
// the process's current registry (0 server name, 1 DEBUG, 2 schema,
// 4 LOGSTDOUT, 7 the path).
#pragma once

#include <cstddef>
#include <cstdint>

// Parameter types.
enum : int32_t {
  PARM_INTEGER = 0,
  PARM_BOOLEAN = 1,
  PARM_STRING = 2,
  PARM_COMMAND = 3,
  PARM_PLACEHOLDER = 4,
};

// Value sources, in rising priority.
enum : int32_t {
  PARM_SRC_DEFAULT = 0,
  PARM_SRC_TABLE = 1,        // read from a parameters table
  PARM_SRC_COMMANDLINE = 2,
  PARM_SRC_CHGPARMS = 3,
  PARM_SRC_SYSTEM = 4,       // system override
  PARM_SRC_KAPPLY = 5,       // K Apply override
};

constexpr int KLP_PARM_SLOTS = 64;          // slots of a registry
constexpr int KLP_PARM_NAME_MAX = 32;       // longest parameter name
constexpr int KLP_PARM_VALUE_MAX = 1040;    // longest STRING / COMMAND text
constexpr int KLP_PARM_TABLE_NAME_MAX = 128;

// The parameter query message: a 10-byte header, then per parameter shown a
// record of 40 bytes and the value. At most one record per slot.
constexpr size_t KLP_QUERY_HEADER_SIZE = 10;
constexpr size_t KLP_QUERY_RECORD_FIXED = 40;
constexpr size_t KLP_QUERY_MSG_MAX =
    KLP_QUERY_HEADER_SIZE + KLP_PARM_SLOTS * (KLP_QUERY_RECORD_FIXED + KLP_PARM_VALUE_MAX);

// Well-known parameter numbers, the same in every parameter set.
enum : int {
  PARM_IDX_SERVER = 0,
  PARM_IDX_DEBUG = 1,
  PARM_IDX_SCHEMA = 2,
  PARM_IDX_LOGSTDOUT = 4,
  PARM_IDX_PWDFILE = 6,
  PARM_IDX_PATH = 7,
};

// One parameter: the layout of a compiled-in table entry and of a registry
// slot alike (the table's values are the slot's initial values).
struct ParmEntry {
  int32_t index;        // parameter number; -1 in a placeholder slot
  // Upper case, zero-terminated. The extra byte lets the constructor tell a
  // table name of 33 or more characters (refused) from one of exactly 32.
  char name[KLP_PARM_NAME_MAX + 1];
  int32_t matchLength;  // leading characters that must match; 0 = whole name
  int32_t type;         // PARM_INTEGER .. PARM_PLACEHOLDER
  int32_t minimum;      // INTEGER: lowest value; -1 otherwise
  int32_t maximum;      // INTEGER: highest value; STRING: longest text; -1 otherwise
  int32_t intValue;     // INTEGER: current value; -1 otherwise
  char* strValue;       // STRING/COMMAND: current text (table: the default, only read)
  int32_t boolValue;    // BOOLEAN: 0/1; COMMAND: 1 once named
  int32_t source;       // PARM_SRC_*; 0 in every table
  int32_t display;      // 1 always printed; -1 when not DEFAULT; other: never
  int32_t changeable;   // nonzero: may be changed by CHGPARMS
};

// Builds a table entry; the default text is only read by the constructor. A
// name longer than 32 characters is kept unterminated so that the registry
// refuses it.
ParmEntry makeParmEntry(int32_t index, const char* name, int32_t matchLength, int32_t type,
                        int32_t minimum, int32_t maximum, int32_t intValue,
                        const char* strValue, int32_t boolValue, int32_t display,
                        int32_t changeable);

// One pending CHGPARMS change: a server parameter number (-1 when the record
// is free) and its new value text.
struct ChgParmsEntry {
  int32_t index;
  char value[KLP_PARM_VALUE_MAX];
};

// The label printouts show for a source; source 1 shows tableName.
const char* parmSourceLabel(int32_t source, const char* tableName);

// The process-wide empty text: a slot pointing at it owns nothing.
extern char klpEmptyText[1];

class klpParmClass {
 public:
  // Builds the slots from table[0..n-1]; rc is 0 or 2002 (an entry refused).
  klpParmClass(const ParmEntry* table, int n, int* rc);
  virtual ~klpParmClass();
  klpParmClass(const klpParmClass&) = delete;
  klpParmClass& operator=(const klpParmClass&) = delete;

  // argv[0] is the program name. Base rule: preCmdLine then parseCmdLine.
  virtual int processCommandLine(int argc, char** argv);
  // Keyword -> index of a changeable parameter, or -1.
  virtual int findChangeableParm(const char* keyword);

  // Typed setters: 0, or 2002 with a catalogue message. A value whose
  // source is below the slot's current source is dropped (still 0).
  int setParm(int index, int32_t value, int32_t source);  // INTEGER
  int setParmBool(int index, int32_t value, int32_t source);  // BOOLEAN 0/1
  int setParm(int index, const char* text, int32_t source);  // STRING
  int setCommand(int index, int32_t flag, const char* text, int32_t source);
  int setBool(int index, char yesNo, int32_t source);
  // Stores a value given as text by the parameter's type (INTEGER decimal,
  // BOOLEAN Y/YES/N/NO, STRING as is), as a CHGPARMS change does in a server.
  // 2002 when isValidValue refuses it or the setter does.
  int setParmValue(int index, const char* text, int32_t source);

  // Getters: out-of-range or wrong type writes a line to standard output and
  // answers -1 / 0 / null.
  int32_t getParmInt(int index) const;
  int32_t getParmBool(int index) const;
  const char* getParmString(int index) const;
  int32_t getParmType(int index) const;
  int32_t getParmSource(int index) const;
  const char* getParmName(int index) const;
  bool isValidValue(int index, const char* text) const;

  // The COMMAND named on the command line (the last in index order whose
  // flag is set), or -1; and the argument text of a COMMAND slot.
  int getNamedCommand() const;
  const char* getCommandText(int index) const;

  // Command-line steps (the derived classes string them together).
  int preCmdLine(int argc, char** argv);
  int getPositionalDBName(int argc, char** argv, int* consumed);
  int parseCmdLine(int argc, char** argv);

  // The parameter query message and printout.
  size_t getQueryMsgSize() const;
  int setQueryMsg(void* buffer) const;
  // Prints the records of a received message of msgLen bytes. 0, or 2002
  // when the message is malformed (the records before it were printed).
  int getQueryMsg(const void* msg, size_t msgLen) const;
  void printParms() const;

  // Owner-set links.
  void setUsageText(const char* text) { usage_ = text ? text : klpEmptyText; }
  const char* getUsageText() const { return usage_; }
  void setServerParms(klpParmClass* server) { serverParms_ = server; }
  klpParmClass* getServerParms() const { return serverParms_; }
  void setTableName(const char* name);
  const char* getTableName() const { return tableName_; }

  int getCount() const { return count_; }
  // The slot of a parameter without any printout; null outside 0..count-1.
  const ParmEntry* peekSlot(int index) const {
    return index >= 0 && index < count_ ? &slots_[index] : nullptr;
  }

  // Pending CHGPARMS changes: the number of used records, and record i
  // (0..63, null outside).
  int getChgParmsCount() const { return chgCount_; }
  const ChgParmsEntry* getChgParmsEntry(int i) const;
  // Stores (index, value) in the record of that index or the first free one;
  // 2002 when all records hold other parameters or the value is too long.
  int addChgParm(int index, const char* value);

 protected:
  // Slot lookup by the keyword rule; anyType false accepts only BOOLEAN and
  // COMMAND slots. Answers the slot position or -1.
  int findSlot(const char* upperKeyword, size_t keywordLen, bool anyType) const;
  bool indexOk(int index) const;
  ParmEntry& slot(int index) { return slots_[index]; }
  const ParmEntry& slot(int index) const { return slots_[index]; }

 private:
  void mirrorLogStdout(int index, int32_t value) const;
  // Replaces the text of a STRING slot, keeping its source (rules that
  // rewrite a value in place: schema, path, server name).
  void replaceSlotText(int index, const char* text);
  // The schema rule applied to parameter 2 in place; false when it breaks it.
  bool normaliseSchema();

  char tableName_[KLP_PARM_TABLE_NAME_MAX];
  int32_t count_ = 0;
  ParmEntry slots_[KLP_PARM_SLOTS];
  const char* usage_ = klpEmptyText;
  klpParmClass* serverParms_ = nullptr;
  int32_t chgCount_ = 0;
  ChgParmsEntry chg_[KLP_PARM_SLOTS];
};

// The process-wide current parameter object (null until a program sets it).
// Setting it also lets the message logger read its string parameters.
klpParmClass* klpGetCurrentParms();
void klpSetCurrentParms(klpParmClass* parms);
