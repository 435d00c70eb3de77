// Fuzz target: an argument vector made from the input (arguments separated
// by zero bytes, so they may be empty, very long or not UTF-8) parsed by both
// parameter sets.
#include <cstdint>
#include <cstdlib>
#include <string>
#include <vector>

#include "xqpub/kcapcmdparms.h"
#include "xqpub/xqpubparms.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  // The first byte picks whether ORACLE_SID is set; the rest are arguments.
  if (size > 0 && (data[0] & 1))
    setenv("ORACLE_SID", (data[0] & 2) ? "FUZZDB" : "", 1);
  else
    unsetenv("ORACLE_SID");

  std::vector<std::string> args = {"klpkccmd"};
  std::string cur;
  for (size_t i = size > 0 ? 1 : 0; i < size && args.size() < 64; ++i) {
    if (data[i] == 0) {
      args.push_back(cur);
      cur.clear();
    } else {
      cur.push_back(static_cast<char>(data[i]));
    }
  }
  if (size > 1) args.push_back(cur);
  std::vector<char*> argv;
  for (auto& a : args) argv.push_back(a.data());
  argv.push_back(nullptr);
  int argc = static_cast<int>(args.size());

  ParmEntry ct[KCAPCMD_PARM_COUNT];
  buildKCapCmdParmTable(ct);
  ParmEntry st[XQPUB_PARM_COUNT];
  buildXqpubParmTable(st);
  int rc = 0;
  xqpubParms server(st, XQPUB_PARM_COUNT, &rc);
  kCapCmdParmClass cmd(ct, KCAPCMD_PARM_COUNT, &rc);
  cmd.setServerParms(&server);
  cmd.setUsageText(kCapCmdUsageText);
  cmd.processCommandLine(argc, argv.data());
  server.processCommandLine(argc, argv.data());
  // Whatever was accepted must read back as terminated text.
  for (int i = 0; i < cmd.getChgParmsCount(); ++i) (void)std::string(cmd.getChgParmsEntry(i)->value);
  for (int i = 0; i < XQPUB_PARM_COUNT; ++i) {
    const ParmEntry* s = server.peekSlot(i);
    if (s->type == PARM_STRING) (void)std::string(s->strValue);
  }
  std::vector<uint8_t> msg(server.getQueryMsgSize());
  server.setQueryMsg(msg.data());
  if (server.getQueryMsg(msg.data(), msg.size()) != 0) abort();  // own messages always parse
  return 0;
}
