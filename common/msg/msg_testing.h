// Helpers for the logger tests: a piece of code run in a forked child with
// its standard output and error going to files, so the exact console lines
// can be checked without disturbing the test process.
#pragma once

#include <functional>
#include <string>

#include "tests/testing/klptest.h"

namespace msgtest {

struct Captured : klptest::Child {
  bool finished = false;  // the child ended by itself within the time allowed
};

inline Captured inChild(const std::string& dir, const std::function<int()>& body,
                        int timeoutMs = 20000) {
  Captured c;
  static_cast<klptest::Child&>(c) = klptest::inChild(dir, body, timeoutMs);
  c.finished = c.exited;
  return c;
}

using klptest::lines;

}  // namespace msgtest
