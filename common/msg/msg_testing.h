// Helpers for the logger tests: run a piece of code in a forked child with
// its standard output and error going to files, so the exact console lines
// can be checked without disturbing the test process.
#pragma once

#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <functional>
#include <string>

#include "common/platform/hsv.h"
#include "tests/testing/klptest.h"

namespace msgtest {

struct Captured {
  bool finished = false;  // the child ended by itself within the time allowed
  int exitCode = -1;
  std::string out;
  std::string err;
};

// Runs body in a child whose stdout and stderr go to files under dir (which
// ends in "/"). The child exits with body's answer. Waits at most timeoutMs.
inline Captured inChild(const std::string& dir, const std::function<int()>& body,
                        int timeoutMs = 20000) {
  static int serial = 0;
  std::string base = dir + "child" + std::to_string(++serial);
  std::string outFile = base + ".out", errFile = base + ".err";
  fflush(stdout);
  fflush(stderr);
  Captured c;
  pid_t pid = fork();
  if (pid == 0) {
    int o = open(outFile.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
    int e = open(errFile.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
    if (o < 0 || e < 0) _exit(99);
    dup2(o, 1);
    dup2(e, 2);
    int rc = body();
    fflush(stdout);
    fflush(stderr);
    _exit(rc);
  }
  if (pid < 0) return c;
  int status = 0;
  for (int waited = 0;; waited += 10) {
    pid_t r = waitpid(pid, &status, WNOHANG);
    if (r == pid) {
      c.finished = WIFEXITED(status);
      c.exitCode = c.finished ? WEXITSTATUS(status) : -1;
      break;
    }
    if (waited >= timeoutMs) {
      kill(pid, SIGKILL);
      waitpid(pid, &status, 0);
      break;
    }
    hsvSleep(10);
  }
  c.out = klptest::readFile(outFile);
  c.err = klptest::readFile(errFile);
  return c;
}

// Lines of a text, without their line feeds.
inline std::vector<std::string> lines(const std::string& text) {
  std::vector<std::string> out;
  size_t start = 0;
  while (start < text.size()) {
    size_t nl = text.find('\n', start);
    if (nl == std::string::npos) nl = text.size();
    out.push_back(text.substr(start, nl - start));
    start = nl + 1;
  }
  return out;
}

}  // namespace msgtest
