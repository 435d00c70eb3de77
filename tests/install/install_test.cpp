// The installed tree and package: every piece in place, programs running from the prefix alone, an own program.
#include <unistd.h>

#include <fstream>

#include "tests/install/install_support.h"

using installtest::hidden;
using installtest::prefix;
using installtest::shell;
using installtest::tmp;
using klptest::ProcessResult;

namespace {

const std::string kLib = KLP_LIBDIR;

// Installed files, and for a link what it points to.
struct Piece {
  std::string path, linkTo;
};
const std::vector<Piece> kPieces = {
    {"bin/klpkccmd", ""}, {"bin/klptrc", ""}, {"bin/klptrcbp", ""}, {"bin/klpkcap", ""},
    {kLib + "/libklp.so", "libklp.so.9"}, {kLib + "/libklp.so.9", "libklp.so.9.1.0"}, {kLib + "/libklp.so.9.1.0", ""},
    {kLib + "/pkgconfig/klp.pc", ""}, {kLib + "/cmake/klp/klpConfig.cmake", ""},
    {kLib + "/cmake/klp/klpConfigVersion.cmake", ""}, {"include/klp/klpapi.h", ""}, {"include/klp/klptrc.h", ""},
    {"share/klp/vdbklp.mo", ""}, {"share/man/man1/klpkccmd.1", ""}, {"share/man/man1/klptrc.1", ""},
    {"share/man/man1/klpkcap.1", ""}, {"share/man/man1/klptrcbp.1", ""}, {"share/man/man3/klpapi.3", ""},
    {"share/man/man3/klpGetStatus.3", ""}, {"share/bash-completion/completions/klpkccmd", ""},
    {"share/bash-completion/completions/klptrc", ""},
};

bool contains(const std::string& text, const std::string& part) {
  return text.find(part) != std::string::npos;
}

}  // namespace

TEST(Install, EveryPieceLiesWhereOperatorsLook) {
  for (const Piece& p : kPieces) {
    std::string path = prefix() + "/" + p.path;
    char target[256] = {};
    ssize_t n = readlink(path.c_str(), target, sizeof target - 1);
    EXPECT_EQ(n > 0 ? std::string(target, static_cast<size_t>(n)) : "", p.linkTo) << p.path;
    EXPECT_EQ(access(path.c_str(), p.path.rfind("bin/", 0) == 0 ? X_OK : R_OK), 0) << p.path;
  }
  ProcessResult elf = shell("readelf -d " + prefix() + "/bin/* " + prefix() + "/" + kLib +
                            "/libklp.so.9.1.0");
  EXPECT_TRUE(contains(elf.out, "Library soname: [libklp.so.9]")) << elf.out;
  EXPECT_FALSE(contains(elf.out, "PATH")) << "no installed object searches a build directory";
}

TEST(Install, ProgramsRunFromThePrefixAloneWithTheBuildOutOfReach) {
  const std::string dir = tmp().path(), bin = prefix() + "/bin/";
  ProcessResult on = klptest::run(hidden(dir, {bin + "klptrc", "on", "-db", "INST", "-kcap"}));
  EXPECT_TRUE(contains(on.out, "Trace is turned on, with IPC key")) << on.out << on.err;
  EXPECT_FALSE(contains(on.out, "Create Process failed")) << "the keeper comes from the prefix";
  ProcessResult off = klptest::run(hidden(dir, {bin + "klptrc", "off", "-db", "INST", "-kcap"}));
  EXPECT_TRUE(contains(off.out, "Trace is turned off.")) << off.out;
  EXPECT_FALSE(klptest::memoryExists(dir + "INST.KLP.KCAP.TRC"));

  klptest::Background server(
      hidden(dir, {bin + "klpkcap", "CAPTURE_SERVER=INST", "CAPTURE_PATH=" + dir}));
  const std::string queue = dir + "INST.KLP.KCAP.IPC";
  ASSERT_TRUE(klptest::waitFor([&] { return klptest::queueExists(queue); }, 60000)) << server.out();
  // The texts come from the catalogue only: the built-in table has none such.
  for (auto [command, says] : {std::pair{"STATUS", "KLP0520I"}, {"STOP", "KLP0522I"}}) {
    ProcessResult r = klptest::run(hidden(dir, {bin + "klpkccmd", "CAPTURE_SERVER=INST", command}));
    EXPECT_EQ(r.exitCode, 0) << command << r.out << r.err;
    EXPECT_TRUE(contains(r.out, says) && !contains(r.out + r.err, "KLP0513E")) << command << r.out;
  }
  EXPECT_EQ(server.wait(30000).exitCode, 0) << server.out() << server.err();
  EXPECT_FALSE(klptest::queueExists(queue));
}

TEST(Install, OwnProgramBuildsFromPkgConfigAndFindPackage) {
  const std::string dir = tmp().path(), src = KLP_SOURCE_DIR "/tests/install/status_client.c";
  const std::string cc = std::string(KLP_CC) + " " + KLP_SANITIZE_FLAGS;
  ProcessResult pc = shell(cc + " -o " + dir + "bypc " + src +
                               " $(pkg-config --cflags --libs klp) -Wl,-rpath," + prefix() + "/" + kLib,
                           {"PKG_CONFIG_PATH=" + prefix() + "/" + kLib + "/pkgconfig"});
  ASSERT_EQ(pc.exitCode, 0) << pc.out << pc.err;

  const std::string proj = dir + "proj/";
  ASSERT_EQ(shell("mkdir -p " + proj + " && cp " + src + " " + proj).exitCode, 0);
  std::ofstream(proj + "CMakeLists.txt") << "cmake_minimum_required(VERSION 3.20)\nproject(own C)\n"
      "find_package(klp 9 REQUIRED)\nadd_executable(bycmake status_client.c)\n"
      "target_link_libraries(bycmake klp::klp)\n";
  ProcessResult cm = shell(std::string(KLP_CMAKE) + " -S " + proj + " -B " + proj + "b -DCMAKE_PREFIX_PATH=" +
                           prefix() + " \"-DCMAKE_C_FLAGS=" + KLP_SANITIZE_FLAGS + "\" >/dev/null && " +
                           KLP_CMAKE + " --build " + proj + "b");
  ASSERT_EQ(cm.exitCode, 0) << cm.out << cm.err;
  ProcessResult size = klptest::run({proj + "b/bycmake"});
  EXPECT_EQ(size.out, "size 0 2224\n") << size.err;

  klptest::Background server({prefix() + "/bin/klpkcap", "CAPTURE_SERVER=OWN", "CAPTURE_PATH=" + dir});
  const std::string queue = dir + "OWN.KLP.KCAP.IPC";
  ASSERT_TRUE(klptest::waitFor([&] { return klptest::queueExists(queue); }, 60000)) << server.out();
  ProcessResult own = klptest::run({dir + "bypc", "OWN"});
  EXPECT_EQ(own.out, "status 0 format 3 required 2224\nstop 0\n") << own.err;
  EXPECT_EQ(server.wait(30000).exitCode, 0) << server.out() << server.err();
}

TEST(Package, DebianPackageHoldsTheInstallLayoutAndComputedDependencies) {
  const std::string out = tmp().path() + "pkg";
  ProcessResult made = klptest::run({KLP_CPACK, "--config", KLP_BUILD_DIR "/CPackConfig.cmake", "-B", out});
  ASSERT_EQ(made.exitCode, 0) << made.out << made.err;
  std::string deb = shell("ls " + out + "/klp_9.1.0_*.deb").out;
  ASSERT_FALSE(deb.empty());
  deb.pop_back();
  ProcessResult files = shell("dpkg-deb -c " + deb);
  for (const Piece& p : kPieces)
    EXPECT_TRUE(contains(files.out, " ./usr/" + p.path)) << p.path << "\n" << files.out;
  ProcessResult depends = shell("dpkg-deb -f " + deb + " Depends");
  // Found by dpkg-shlibdeps: the C library for everything, ICU for libklp.
  EXPECT_TRUE(contains(depends.out, "libc6 (>=")) << depends.out;
  EXPECT_TRUE(contains(depends.out, "libicu")) << depends.out;
}
