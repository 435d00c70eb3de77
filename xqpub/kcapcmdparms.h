// The command program's own parameter set: the server name and schema, a few
// switches, and the command words an operator can send to a K Capture
// server. Slots of the server set that the command program does not use are
// kept as "KLPPLACEHOLDER" entries so that the numbering matches it.
#pragma once

#include "common/parms/klpparm.h"

constexpr int KCAPCMD_PARM_COUNT = 26;

// Command words: the parameter index is also the function code sent.
enum : int {
  KCAPCMD_TRCSTART = 10,
  KCAPCMD_STOP = 14,
  KCAPCMD_STATUS = 15,
  KCAPCMD_RESERVED = 16,
  KCAPCMD_QRYPARMS = 17,
  KCAPCMD_RESUME = 18,
  KCAPCMD_SUSPEND = 19,
  KCAPCMD_CHGPARMS = 20,
  KCAPCMD_REINIT = 21,
  KCAPCMD_PRUNE = 22,
  KCAPCMD_REINITQ = 23,
  KCAPCMD_STARTQ = 24,
  KCAPCMD_STOPQ = 25,
};

// Fills table[0..25] with the command table, in table order.
void buildKCapCmdParmTable(ParmEntry* table);

// The text printed for "?" (892 characters).
extern const char kCapCmdUsageText[];

class kCapCmdParmClass : public klpParmClass {
 public:
  kCapCmdParmClass(const ParmEntry* table, int n, int* rc) : klpParmClass(table, n, rc) {}
  // argv[0] is the program name. Collects the pairs after CHGPARMS into the
  // pending records (checked against the server set given by
  // setServerParms), parses the rest and requires exactly one command.
  int processCommandLine(int argc, char** argv) override;
};
