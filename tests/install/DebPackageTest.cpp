// The Debian package built by CPack holds the installed tree, enables the
// socket unit without starting anything, and its programs run from where
// it is unpacked.

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

#include "tests/support/DaemonProcess.h"
#include "tests/support/Subprocess.h"
#include "tests/support/TempDirectory.h"

namespace tn::test {
namespace {

namespace fs = std::filesystem;

std::string describe(const ProcessResult& result) {
  return "exit " + std::to_string(result.exitStatus) + "\n" + result.out + result.err;
}

// Whether `dpkg-deb --contents` lists path (a file, or a link: "path -> target").
bool listed(const std::string& contents, const std::string& path) {
  return contents.find(" " + path + "\n") != std::string::npos || contents.find(" " + path + " -> ") != std::string::npos;
}

// What the package must hold: the programs, the library and what builds
// against it, and every unit and manual page the source tree has.
std::vector<std::string> expectedContents() {
  std::vector<std::string> expected = {
      "." TENON_INSTALL_FULL_SBINDIR "/tenond",
      "." TENON_INSTALL_FULL_BINDIR "/tnctl",
      "." TENON_INSTALL_FULL_LIBDIR "/libtenon.so",
      "." TENON_INSTALL_FULL_LIBDIR "/pkgconfig/tenon.pc",
      "." TENON_INSTALL_FULL_LIBDIR "/cmake/Tenon/TenonConfig.cmake",
      "." TENON_INSTALL_FULL_INCLUDEDIR "/tenon/TNDaemonClient.h",
      "." TENON_INSTALL_FULL_DATADIR "/bash-completion/completions/tnctl",
      "./etc/tenon/entitlements.d/tnctl.manifest",
  };
  const fs::path source = TENON_SOURCE_DIR;
  expected.push_back("." TENON_INSTALL_PREFIX "/lib/tmpfiles.d/tenon.conf");
  for (const auto& [folder, destination] : {std::pair{"packaging/systemd/system", "/lib/systemd/system/"},
                                            std::pair{"packaging/systemd/user", "/lib/systemd/user/"}}) {
    if (!fs::is_directory(source / folder)) continue;
    for (const auto& unit : fs::directory_iterator(source / folder)) {
      if (!unit.is_regular_file()) continue;
      std::string name = unit.path().filename().string();
      if (name.ends_with(".in")) name.resize(name.size() - 3);
      expected.push_back("." TENON_INSTALL_PREFIX + std::string(destination) + name);
    }
  }
  if (fs::is_directory(source / "docs/man")) {
    for (const auto& page : fs::directory_iterator(source / "docs/man")) {
      const std::string name = page.path().filename().string();
      const char section = name.back();
      if (section < '1' || section > '8') continue;
      expected.push_back("." TENON_INSTALL_FULL_MANDIR "/man" + std::string(1, section) + "/" + name);
    }
  }
  return expected;
}

// Runs the package's postinst ("configure") on the unpacked tree with
// stand-ins for the service manager's tools that record what they are asked.
void expectPostinstEnablesEverySocketAndStartsNothing(const std::string& deb, const TempDirectory& unpacked) {
  TempDirectory scratch;
  const fs::path script = scratch / "postinst";
  const ProcessResult postinst = runProcess({TENON_DPKG_DEB, "--info", deb, "postinst"});
  ASSERT_EQ(postinst.exitStatus, 0) << describe(postinst);
  std::ofstream(script) << postinst.out;
  const fs::path tools = scratch / "bin";
  const fs::path calls = scratch / "calls";
  fs::create_directories(tools);
  for (const char* tool : {"deb-systemd-helper", "systemctl", "systemd-tmpfiles"}) {
    std::ofstream(tools / tool) << "#!/bin/sh\necho \"$(basename \"$0\") $*\" >> " << calls.string()
                                << "\nexit 1\n";  // "was-enabled": no
    fs::permissions(tools / tool, fs::perms(0755));
  }
  const ProcessResult ran = runProcess({"/bin/sh", script.string(), "configure"},
                                       {"PATH=" + tools.string() + ":/usr/bin:/bin", "DPKG_ROOT=" + unpacked.path()});
  ASSERT_EQ(ran.exitStatus, 0) << describe(ran);
  std::ifstream recorded(calls);
  const std::string log((std::istreambuf_iterator<char>(recorded)), std::istreambuf_iterator<char>());
  for (const char* socket : {"tenond.socket", "tenond-warden.socket", "tenond-vigil.socket"})
    EXPECT_NE(log.find(std::string("deb-systemd-helper enable ") + socket), std::string::npos) << log;
  EXPECT_NE(log.find("systemd-tmpfiles --create tenon.conf"), std::string::npos) << log;
  EXPECT_EQ(log.find("start"), std::string::npos) << "installing must start nothing: " << log;
}

TEST(DebianPackage, HoldsTheInstalledTreeEnablesTheSocketAndRunsUnpacked) {
  TempDirectory packages;
  const ProcessResult packed = runProcess(
      {TENON_CPACK_COMMAND, "--config", TENON_BINARY_DIR "/CPackConfig.cmake", "-B", packages.path()});
  ASSERT_EQ(packed.exitStatus, 0) << describe(packed);
  std::string deb;
  for (const auto& entry : fs::directory_iterator(packages.path())) {
    if (entry.path().extension() == ".deb") deb = entry.path().string();
  }
  ASSERT_FALSE(deb.empty()) << "no .deb in " << packed.out;

  const ProcessResult contents = runProcess({TENON_DPKG_DEB, "--contents", deb});
  ASSERT_EQ(contents.exitStatus, 0) << describe(contents);
  for (const std::string& path : expectedContents()) {
    EXPECT_TRUE(listed(contents.out, path)) << path << " is not in the package";
  }

  TempDirectory unpacked;
  const ProcessResult extracted = runProcess({TENON_DPKG_DEB, "--extract", deb, unpacked.path()});
  ASSERT_EQ(extracted.exitStatus, 0) << describe(extracted);
  expectPostinstEnablesEverySocketAndStartsNothing(deb, unpacked);

  DaemonProcess daemon(unpacked / TENON_INSTALL_FULL_SBINDIR "/tenond");
  ASSERT_TRUE(daemon.accepting()) << daemon.log();
  const ProcessResult matched = runProcess(
      {unpacked / TENON_INSTALL_FULL_BINDIR "/tnctl", "--json", "--service", daemon.service(), "match"},
      daemon.environment());
  EXPECT_EQ(matched.exitStatus, 0) << describe(matched) << daemon.log();
}

}  // namespace
}  // namespace tn::test
