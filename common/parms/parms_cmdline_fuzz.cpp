// Fuzz target: an argument vector made from the input (the first byte picks
// ORACLE_SID; then arguments separated by zero bytes, so they may be empty,
// very long or not UTF-8) parsed by both parameter sets.
#include <cstdint>
#include <cstdlib>
#include <string>
#include <vector>

#include "xqpub/kcapcmdparms.h"
#include "xqpub/xqpubparms.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size > 0 && (data[0] & 1))
    setenv("ORACLE_SID", (data[0] & 2) ? "FUZZDB" : "", 1);
  else
    unsetenv("ORACLE_SID");
  std::vector<std::string> args = {"klpkccmd", ""};
  for (size_t i = 1; i < size && args.size() < 64; ++i)
    data[i] ? args.back().push_back(static_cast<char>(data[i])) : args.push_back("");
  if (size < 2) args.pop_back();
  std::vector<char*> argv;
  for (auto& a : args) argv.push_back(a.data());
  argv.push_back(nullptr);

  ParmEntry ct[KCAPCMD_PARM_COUNT], st[XQPUB_PARM_COUNT];
  buildKCapCmdParmTable(ct);
  buildXqpubParmTable(st);
  int rc = 0;
  xqpubParms server(st, XQPUB_PARM_COUNT, &rc);
  kCapCmdParmClass cmd(ct, KCAPCMD_PARM_COUNT, &rc);
  cmd.setServerParms(&server);
  cmd.setUsageText(kCapCmdUsageText);
  cmd.processCommandLine(static_cast<int>(args.size()), argv.data());
  server.processCommandLine(static_cast<int>(args.size()), argv.data());
  // Whatever was accepted reads back as terminated text, and the server's
  // own query message always parses.
  for (int i = 0; i < cmd.getChgParmsCount(); ++i) (void)std::string(cmd.getChgParmsEntry(i)->value);
  for (int i = 0; i < XQPUB_PARM_COUNT; ++i)
    if (server.peekSlot(i)->type == PARM_STRING) (void)std::string(server.peekSlot(i)->strValue);
  std::vector<uint8_t> msg(server.getQueryMsgSize());
  server.setQueryMsg(msg.data());
  if (server.getQueryMsg(msg.data(), msg.size()) != 0) abort();
  return 0;
}
