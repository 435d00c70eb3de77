// The installed man pages render without a warning and name the values
// operators need; bash completion offers the words of the right set.
#include "tests/install/install_support.h"

using installtest::prefix;
using installtest::shell;
using klptest::ProcessResult;

TEST(ManPages, RenderWithoutWarningsAndListTheValues) {
  // Each page, and what its rendered text shows.
  const std::vector<std::pair<std::string, std::vector<std::string>>> pages = {
      {"man1/klpkccmd.1", {"CHGPARMS", "SUSPEND", "COMMIT_INTERVAL=n", "Integer from 100 to 600000; default 500.",
                           "QFULL_N", "ORACLE_SID", "KLP_CATALOG_DIR"}},
      {"man1/klptrc.1", {"-holdlock", "-listsymbols", "json", "Default 2097152.", "TMPDIR"}},
      {"man1/klpkcap.1", {"STARTMODE=text", "default WARMSI", "LOGBUF=n", "Not shown by QRYPARMS"}},
      {"man1/klptrcbp.1", {"ipc-directory name-prefix"}},
      {"man3/klpapi.3", {"klpGetStatusSize", "2013 KLP_API_NOT_ATTACHABLE", "pkg-config"}},
      {"man3/klpGetStatus.3", {"klpGetStatusSize"}},  // a link to klpapi(3)
  };
  for (const auto& [file, shows] : pages) {
    // As man does it, from the top of the man tree (where a link's .so is resolved); plain text.
    ProcessResult r = shell("cd " + prefix() + "/share/man && groff -s -ww -man -Tutf8 -P-cbu " + file);
    EXPECT_EQ(r.exitCode, 0) << file;
    EXPECT_EQ(r.err, "") << file;
    for (const std::string& s : shows) EXPECT_NE(r.out.find(s), std::string::npos) << file << ": " << s;
  }
}

TEST(Completion, OffersTheWordsOfTheRightSet) {
  // COMP_WORDS as bash splits the line ("X=" is X and "="); the last word is completed; answers sorted.
  const std::string dir = installtest::tmp().path();
  ASSERT_EQ(shell("touch " + dir + "trace.trc").exitCode, 0);
  const std::vector<std::pair<std::vector<std::string>, std::string>> cases = {
      {{"klpkccmd", "st"}, "STARTQ= STATUS STOP STOPQ="},
      {{"klpkccmd", "capture_s"}, "CAPTURE_SCHEMA= CAPTURE_SERVER="},
      {{"klpkccmd", "STOP", "s"}, ""}, {{"klpkccmd", "LOGSTDOUT", "="}, "N Y"}, {{"klpkccmd", "status", "s"}, "SHOW"},
      {{"klpkccmd", "STATUS", "SHOW", ""}, "DETAILS"},
      {{"klpkccmd", "CHGPARMS", "S"}, "SIGNAL_LIMIT= SLEEP_INTERVAL= STALE="},
      {{"klpkccmd", "CHGPARMS", "C"}, "COMMIT_INTERVAL="}, {{"klpkccmd", "CHGPARMS", "TERM", "=", "y"}, "Y"},
      {{"klpkccmd", "CHGPARMS", "COMMIT_INTERVAL", "=", "1000", "Q"}, "QFULL_NUM_RETRIES= QFULL_RETRY_DELAY="},
      {{"klpkccmd", "CHGPARMS", "COMMIT_INTERVAL", "="}, ""},
      {{"klpkccmd", "CHGPARMS", "TERM", "=", "N", "CAPTURE_SERVER", "=", "X", ""},
       "CAPTURE_SCHEMA= CAPTURE_SERVER= DEBUG KLPTRC LOGSTDOUT"},
      {{"klptrc", "st"}, "stat statg statlong"}, {{"klptrc", "-K"}, "-kapp -kcap"}, {{"klptrc", "on", "-db", ""}, ""},
      {{"klptrc", "fmt", "-df", "main", ""}, ""}, {{"klptrc", "fmt", "-fn", dir + "tr"}, dir + "trace.trc"},
  };
  const std::string completions = prefix() + "/share/bash-completion/completions/";
  for (const auto& [words, want] : cases) {
    std::vector<std::string> argv = {
        KLP_BASH, "-c",
        "source \"$1\" && COMP_CWORD=$2 && shift 2 && COMP_WORDS=(\"$@\") && _$1 && "
        "printf '%s\\n' \"${COMPREPLY[@]}\" | LC_ALL=C sort | paste -sd ' '",
        "x", completions + words[0], std::to_string(words.size() - 1)};
    argv.insert(argv.end(), words.begin(), words.end());
    ProcessResult r = klptest::run(argv);
    EXPECT_EQ(r.out.substr(0, r.out.find('\n')), want) << ::testing::PrintToString(words) << r.err;
  }
}
