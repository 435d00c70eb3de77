// Fuzz target: a parameter query message as received from another process.
#include <cstdint>
#include <vector>

#include "xqpub/xqpubparms.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static xqpubParms* parms = [] {
    static ParmEntry table[XQPUB_PARM_COUNT];
    buildXqpubParmTable(table);
    int rc = 0;
    return new xqpubParms(table, XQPUB_PARM_COUNT, &rc);
  }();
  // An exact-size copy, so that any read past the message is caught.
  std::vector<uint8_t> msg(data, data + size);
  parms->getQueryMsg(msg.empty() ? nullptr : msg.data(), msg.size());
  return 0;
}
