// What the install tests share: the build installed into a fresh prefix once
// per test process, and running programs with the build and source trees out of reach.
#pragma once

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "tests/testing/klptest.h"

namespace installtest {

// The test process's own TMPDIR; removed with everything in it at exit.
inline const klptest::TmpDir& tmp() {
  static klptest::TmpDir dir;
  return dir;
}

inline klptest::ProcessResult shell(const std::string& line, const std::vector<std::string>& env = {}) {
  return klptest::run({"/bin/sh", "-c", line}, env, 120000);
}

// `cmake --install` of the build into a new directory under tmp(), once per process; no trailing "/".
inline const std::string& prefix() {
  static const std::string dir = [] {
    std::string d = tmp().path() + "prefix";
    klptest::ProcessResult r = klptest::run({KLP_CMAKE, "--install", KLP_BUILD_DIR, "--prefix", d});
    EXPECT_EQ(r.exitCode, 0) << r.out << r.err;
    return d;
  }();
  return dir;
}

// argv run from dir with the build and source trees covered and no KLP_CATALOG_DIR or LD_LIBRARY_PATH.
inline std::vector<std::string> hidden(const std::string& dir, const std::vector<std::string>& argv) {
  std::vector<std::string> v = {KLP_UNSHARE, "-rm", "/bin/sh", "-c",
                                "mount -t tmpfs none \"$1\" && mount -t tmpfs none \"$2\" && cd \"$3\" && "
                                "unset KLP_CATALOG_DIR LD_LIBRARY_PATH && shift 3 && exec \"$@\"",
                                "sh", KLP_BUILD_DIR, KLP_SOURCE_DIR, dir};
  v.insert(v.end(), argv.begin(), argv.end());
  return v;
}

}  // namespace installtest
