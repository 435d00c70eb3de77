// The real klpkccmd: usage text, STATUS SHOW DETAILS found before parsing, refusals end as a failed step, exit 12.
#include <gtest/gtest.h>

#include <cstdlib>
#include <string>
#include <vector>

#include "tests/testing/klptest.h"
#include "xqpub/kcapcmdparms.h"

namespace {

TEST(Klpkccmd, RefusalsEndWithTheFailedStepAndExitCode12) {
  klptest::TmpDir dir;
  unsetenv("ORACLE_SID");
  const std::string step = "In \"klpkccmd\" a step failed with return code ";
  struct { std::vector<std::string> args; std::string shown, step; } cases[] = {
      // The program level, then the usage text whole, then the help code.
      {{"?"}, std::string("\n") + kCapCmdUsageText, "\"416\": \"processCommandLine\""},
      {{}, "required parameter \"CAPTURE_SERVER\"", "\"2002\": \"processCommandLine\""},
      // The three words in any case, only as three whole arguments; else the parser sees them.
      {{"X", "status", "show", "details", "EXTRA"}, "argument \"EXTRA\"", "\"2002\""},
      {{"X", "STATUS", "SHOW"}, "argument \"SHOW\"", "\"2002\""},
      {{"X", "STATUS", "SHOWS", "DETAILS"}, "argument \"SHOWS\"", "\"2002\""},
      {{"X", "STATUS", "SHOW", "DETAIL!"}, "argument \"SHOW\"", "\"2002\""},
      {{"X", "STATUS SHOW DETAILS"}, "argument \"STATUS SHOW DETAILS\"", "\"2002\""},
      {{"X", "STOP", "STATUS", "SHOW", "DETAILS"}, "KLP0518E", "\"2002\""},
      // A name prefix too long for its field.
      {{"CAPTURE_SERVER=" + std::string(1039, 'N'), "STOP"}, "KLP0600I", "\"6005\": \"setEnvNamePrefix\""},
  };
  for (const auto& c : cases) {
    std::vector<std::string> argv = {klptest::binPath("klpkccmd")};
    argv.insert(argv.end(), c.args.begin(), c.args.end());
    klptest::ProcessResult r = klptest::run(argv);
    SCOPED_TRACE(&c - cases);
    EXPECT_EQ(r.exitCode, 12) << r.out;
    EXPECT_NE(r.out.find(c.shown), std::string::npos) << r.out;
    EXPECT_NE(r.out.find(step + c.step), std::string::npos) << r.out;
  }
}

}  // namespace
