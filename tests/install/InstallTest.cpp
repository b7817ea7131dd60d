// `cmake --install` into a staging directory gives a tree that a program
// outside the source tree builds against, with pkg-config and with CMake,
// and that program talks to the installed tenond.

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <vector>

#include "tests/install/StagedInstall.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/Subprocess.h"
#include "tests/support/TempDirectory.h"

namespace tn::test {
namespace {

namespace fs = std::filesystem;

const std::string kConsumerDirectory = TENON_SOURCE_DIR "/tests/install/consumer";

std::string readFile(const std::string& path) {
  std::ifstream in(path);
  std::stringstream text;
  text << in.rdbuf();
  return text.str();
}

std::string describe(const ProcessResult& result) {
  return "exit " + std::to_string(result.exitStatus) + "\n" + result.out + result.err;
}

// Runs the built host program against the staged tenond and checks that
// both its requests were answered by the daemon.
void expectHostTalksToInstalledDaemon(const StagedInstall& staged, const std::string& host) {
  DaemonProcess daemon(staged / TENON_INSTALL_FULL_SBINDIR "/tenond");
  ASSERT_TRUE(daemon.accepting()) << daemon.log();
  const ProcessResult run = runProcess({host, daemon.service()}, daemon.environment());
  ASSERT_EQ(run.exitStatus, 0) << describe(run) << daemon.log();
  // An empty registry: the random UUID is unknown, and nothing matches.
  EXPECT_NE(run.out.find("find: "), std::string::npos) << run.out;
  EXPECT_NE(run.out.find("match: 0\n"), std::string::npos) << run.out;
}

TEST(InstalledTree, HoldsProgramsLibraryAndData) {
  StagedInstall staged;
  for (const std::string& installed : {
           std::string(TENON_INSTALL_FULL_SBINDIR "/tenond"),
           std::string(TENON_INSTALL_FULL_BINDIR "/tnctl"),
           std::string(TENON_INSTALL_FULL_LIBDIR "/libtenon.so"),
           std::string(TENON_INSTALL_FULL_LIBDIR "/pkgconfig/tenon.pc"),
           std::string(TENON_INSTALL_FULL_LIBDIR "/cmake/Tenon/TenonConfig.cmake"),
           std::string(TENON_INSTALL_FULL_INCLUDEDIR "/tenon/TNDaemonClient.h"),
           std::string(TENON_INSTALL_FULL_DATADIR "/tenon/extension-points/com.ostrel.thumbnail-provider.manifest"),
           std::string(TENON_INSTALL_FULL_DATADIR "/tenon/sandbox-profiles/plugin.manifest"),
           std::string(TENON_INSTALL_FULL_DATADIR "/bash-completion/completions/tnctl"),
           std::string(TENON_INSTALL_FULL_DATADIR "/doc/tenon/LICENSE"),
           std::string(TENON_INSTALL_FULL_SYSCONFDIR "/tenon/entitlements.d/tnctl.manifest"),
       }) {
    EXPECT_TRUE(fs::exists(staged / installed)) << installed;
  }
  // The entitlement names tnctl where it is installed, not in the build tree.
  EXPECT_NE(readFile(staged / TENON_INSTALL_FULL_SYSCONFDIR "/tenon/entitlements.d/tnctl.manifest")
                .find("\"" TENON_INSTALL_FULL_BINDIR "/tnctl\""),
            std::string::npos);
}

TEST(InstalledTree, EachHeaderCompilesAloneAgainstTheInstalledIncludes) {
  StagedInstall staged;
  TempDirectory sources;
  const std::string includes = staged / TENON_INSTALL_FULL_INCLUDEDIR;
  size_t headers = 0;
  for (const auto& entry : fs::recursive_directory_iterator(includes + "/tenon")) {
    if (entry.path().extension() != ".h") continue;
    const std::string relative = entry.path().lexically_relative(includes).string();
    EXPECT_EQ(readFile(entry.path()).find("#include \""), std::string::npos)
        << relative << " includes a header by its path in the source tree";
    const std::string source = sources / ("header" + std::to_string(++headers) + ".cpp");
    std::ofstream(source) << "#include <" << relative << ">\n";
    const ProcessResult compiled = runProcess({TENON_CXX_COMPILER, "-std=c++20", "-fsyntax-only", "-Wall",
                                               "-Wextra", "-Werror", "-I", includes, source});
    EXPECT_EQ(compiled.exitStatus, 0) << relative << ": " << describe(compiled);
  }
  EXPECT_GE(headers, 10u);
}

TEST(InstalledConsumer, BuiltWithPkgConfigTalksToTheInstalledDaemon) {
  StagedInstall staged;
  TempDirectory build;
  const std::vector<std::string> pkgConfigEnvironment = {
      "PKG_CONFIG_SYSROOT_DIR=" + staged.stage(),
      "PKG_CONFIG_PATH=" + staged.libraryDirectory() + "/pkgconfig"};
  const ProcessResult flags = runProcess({TENON_PKG_CONFIG, "--cflags", "--libs", "tenon"}, pkgConfigEnvironment);
  ASSERT_EQ(flags.exitStatus, 0) << describe(flags);
  EXPECT_NE(flags.out.find("-I" + staged.stage()), std::string::npos) << flags.out;
  EXPECT_NE(flags.out.find("-ltenon"), std::string::npos) << flags.out;

  std::vector<std::string> compile = {TENON_CXX_COMPILER, "-std=c++20", "-o", build / "host",
                                      kConsumerDirectory + "/host.cpp", "-Wl,-rpath," + staged.libraryDirectory()};
  std::istringstream words(flags.out);
  for (std::string word; words >> word;) compile.push_back(word);
  const ProcessResult compiled = runProcess(compile);
  ASSERT_EQ(compiled.exitStatus, 0) << describe(compiled);
  expectHostTalksToInstalledDaemon(staged, build / "host");
}

TEST(InstalledConsumer, BuiltWithCMakeFindPackageTalksToTheInstalledDaemon) {
  StagedInstall staged;
  TempDirectory build;
  const ProcessResult configured =
      runProcess({TENON_CMAKE_COMMAND, "-S", kConsumerDirectory, "-B", build.path(), "-G", "Ninja",
                  "-DCMAKE_CXX_COMPILER=" TENON_CXX_COMPILER, "-DCMAKE_PREFIX_PATH=" + staged.prefix()});
  ASSERT_EQ(configured.exitStatus, 0) << describe(configured);
  const ProcessResult built = runProcess({TENON_CMAKE_COMMAND, "--build", build.path()});
  ASSERT_EQ(built.exitStatus, 0) << describe(built);
  expectHostTalksToInstalledDaemon(staged, build / "host");
}

}  // namespace
}  // namespace tn::test
