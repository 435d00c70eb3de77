// The K Capture server's parameter set. The command program only consults it
// to check the name=value pairs that follow CHGPARMS; a server parses its own
// command line with it.
#pragma once

#include "common/parms/klpparm.h"

constexpr int XQPUB_PARM_COUNT = 56;

// Parameter numbers used by name.
enum : int {
  XQPUB_LOGREUSE = 3,
  XQPUB_TERM = 5,
  XQPUB_DBRANGE = 8,
  XQPUB_KLPTRC = 9,
  XQPUB_TRCSTART = 10,
  XQPUB_SLEEP_INTERVAL = 16,
  XQPUB_IGNORE_TRANSID = 19,
  XQPUB_TRANSID = 20,
  XQPUB_QMGR = 29,
  XQPUB_COMMIT_INTERVAL = 30,
  XQPUB_QFULL_NUM_RETRIES = 37,
  XQPUB_QFULL_RETRY_DELAY = 38,
  XQPUB_RN = 39,
  XQPUB_RD = 40,
  XQPUB_STARTMODE = 43,
  XQPUB_ADMINQ = 48,
  XQPUB_RESTARTQ = 49,
};

// Fills table[0..55] with the server table, in table order.
void buildXqpubParmTable(ParmEntry* table);

class xqpubParms : public klpParmClass {
 public:
  xqpubParms(const ParmEntry* table, int n, int* rc) : klpParmClass(table, n, rc) {}
  // argv[0] is the program name. Refuses QMGR, ADMINQ and RESTARTQ (they come
  // from the control table only), checks STARTMODE and applies the short
  // forms RN, RD and TRANSID.
  int processCommandLine(int argc, char** argv) override;
};
