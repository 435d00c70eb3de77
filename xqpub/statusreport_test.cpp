// The labelled status reports, line by line, and which of them the dispatch
// of STATUS SHOW DETAILS prints for each outcome of the status call.
#include "xqpub/statusreport.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <cstring>
#include <string>
#include <thread>

#include "common/env/klpenv.h"
#include "common/ipc/ipcmsg.h"
#include "common/platform/hsv.h"
#include "include/klpapi.h"
#include "tests/testing/klptest.h"
#include "xqpub/dispatch.h"
#include "xqpub/kcapcmdparms.h"

namespace {

klpStatusFmt3 sampleStatus() {
  klpStatusFmt3 s{};
  s.format = 3, s.upTime = 90061, s.activeSubs = 12, s.currentMemory = 65536;
  std::strcpy(s.logFile, "/var/log/kcap.log");
  std::strcpy(s.currentLogTime, "2024-05-06-07.08.09.000010");
  std::strcpy(s.allPublishedLsn, "00000000ABCDEF01");
  return s;
}

TEST(StatusReport, AValueEndsAfter3000Characters) {
  klpReportRow row[1] = {{0, "L", "K", std::string(5000, 'v')}};
  std::string line;
  klpFormatReport(row, 1, 0, &line);
  EXPECT_EQ(line, "L (K) = " + std::string(3000, 'v'));
}

// The full, short and not-available reports, one after the other; the other
// two never read the status data; the quiet flag silences all three.
TEST(StatusReport, TheThreeReportsAndTheQuietFlag) {
  klptest::ProcessLogger logger;
  auto s = sampleStatus();
  EXPECT_EQ(klptest::stdoutOf([&] {
              klpPrintFullStatus("MYDB", "KLP", &s, 0);
              klpPrintShortStatus("MYDB", "KLP", nullptr, 0);
              klpPrintNotAvailableStatus("MYDB", "KLP", nullptr, 0);
              klpPrintFullStatus("MYDB", "KLP", &s, 1);
              klpPrintShortStatus("MYDB", "KLP", nullptr, 1);
              klpPrintNotAvailableStatus("MYDB", "KLP", nullptr, 1);
            }),
            klptest::readFile(KLP_SOURCE_DIR "/xqpub/statusreports.golden"));
}

// STATUS SHOW DETAILS in process, against a server whose answers are never
// this request's (a queue's worth and more of replies to another function):
// the client counts them as empty polls and gives up, the not-available
// report is printed and the failed step follows.
TEST(StatusReport, DispatchPrintsTheNotAvailableReportWhenNoReplyComes) {
  klptest::TmpDir dir;
  klpEnvClear(klpGetEnv());  // the IPC directory is this test's
  klptest::ProcessLogger log;
  ParmEntry ct[KCAPCMD_PARM_COUNT];
  buildKCapCmdParmTable(ct);
  int rc = -1;
  kCapCmdParmClass cmd(ct, KCAPCMD_PARM_COUNT, &rc);
  klpSetCurrentParms(&cmd);
  cmd.setParm(PARM_IDX_SERVER, "DSP", PARM_SRC_COMMANDLINE);
  HSVResID id;
  HSVHIPCQueue server, reply;
  std::string path = dir.path() + "DSP.KLP.KCAP.IPC";
  ASSERT_EQ(ECF_OK, hsvIPCGetQueResID(path.c_str(), HSV_QUEUE_RESID_OPTION, &id));
  ASSERT_EQ(ECF_OK, server.create(id, HSV_MAX_MSG_SIZE, HSV_CREATE_OPTION));
  std::thread answer([&] {  // the request has come, so the reply queue exists
    char buf[HSV_MAX_MSG_SIZE];
    size_t got = 0;
    IpcMsg* msg = nullptr;
    hsvRC prc;
    if (server.get(buf, sizeof buf, &got, 20000) != ECF_OK ||
        hsvIPCGetQueResID((path + ".CMD" + std::to_string(getpid())).c_str(), HSV_QUEUE_RESID_OPTION, &id) ||
        reply.attach(id) != ECF_OK || createRequestMsg(&msg, IPC_FUNC_STOP, 0, nullptr))
      return;
    for (int i = 0; i < HSV_QUEUE_DEPTH + 16; ++i) putIpcMsgWait(&reply, msg, 5000, &prc);
    freeIpcMsg(msg);
    reply.detach();
  });
  std::string out = klptest::stdoutOf([] { EXPECT_EQ(klpCmdDispatch(1), KLP_API_NO_REPLY); });
  answer.join();
  server.destroy();
  EXPECT_NE(out.find("Detailed status of the K Capture program\n  Server name   (SERVER) = DSP\n"
                     "  Schema name   (SCHEMA) = KLP\n  Not available (STATUS) = Not available\n"),
            std::string::npos) << out;
  std::vector<std::string> records = log.take();
  ASSERT_GE(records.size(), 2u);
  EXPECT_EQ(records.back(), "589 <klpkccmd> 1: klpkccmd|1000|KLPCmdFunc");
  EXPECT_EQ(records.end()[-2], "510 <cmdAPIFunc> 1:");
}

}  // namespace
