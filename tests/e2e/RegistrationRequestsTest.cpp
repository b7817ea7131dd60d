// "add", "remove" and "bulk" end to end: tnctl against the real tenond on a
// private root, with the real registrar behind it, the manager entitlement
// granted (or not) by the document that scripts/install-entitlements
// installs for a copy of tnctl in the root (the build directory's modes
// depend on the umask), and applications copied into a watched root while
// it runs.

#include <gtest/gtest.h>

#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <thread>

#include "platform/value/Document.h"
#include "tests/platform/bundle/BundleTestSupport.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/Subprocess.h"
#include "tests/support/TrustedInstall.h"

namespace tn::test {
namespace {

const std::string kTnctl = std::string(TENON_BINARY_DIR "/tools/tnctl/tnctl");

void writePlugIn(const std::string& bundle, const std::string& identifier) {
  makeBundle(bundle, R"({"BNBundleIdentifier": ")" + identifier + R"(", "BNBundleVersion": "1",
      "XTExtension": {"XTExtensionPointIdentifier": "com.example.thumbnails",
                      "XTExtensionProtocol": "com.example.protocol",
                      "XTExtensionAttributes": {"Kind": "thumb"}}})");
}

class Registration : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_TRUE(daemon_.accepting()) << daemon_.log(); }

  ProcessResult tnctl(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), tnctl_);
    arguments.insert(arguments.end(), {"--service", daemon_.service()});
    return runProcess(arguments, daemon_.environment());
  }
  // From now on tnctl() runs a trusted copy of tnctl that the manager
  // entitlement names.
  void grantManagerEntitlement() {
    const std::string copy = installFile(kTnctl, daemon_.root(), "usr/bin/tnctl");
    const auto installed = runProcess({std::string(TENON_SOURCE_DIR "/scripts/install-entitlements"),
                                       daemon_.root(), copy});
    ASSERT_EQ(installed.exitStatus, 0) << installed.err;
    tnctl_ = copy;
  }
  // The registrar's plug-ins as tnctl lists them from the store.
  std::string registryListing() { return tnctl({"registry", "list"}).out; }

  // Waits (bounded) until the daemon's log holds `text`.
  bool daemonLogs(const std::string& text) {
    for (int i = 0; i < 500; ++i) {
      if (daemon_.log().find(text) != std::string::npos) return true;
      std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    return false;
  }

  DaemonProcess daemon_{tenondBinaryPath()};
  std::string tnctl_ = kTnctl;
};

TEST_F(Registration, AddRegistersInOrderAndStopsAtTheFirstBadPath) {
  const std::string first = daemon_.root() + "/System/Library/PlugIns/First.bundle";
  const std::string missing = daemon_.root() + "/System/Library/PlugIns/Missing.bundle";
  writePlugIn(first, "com.example.first");
  const auto added = tnctl({"add", first, missing});
  EXPECT_EQ(added.exitStatus, 1);
  EXPECT_EQ(added.err, "tnctl: error 9: invalid plugin path: " + missing + "\n");
  EXPECT_NE(registryListing().find("com.example.first"), std::string::npos) << "the path before stays registered";

  // Through a symbolic link the target is what gets registered.
  const std::string target = daemon_.root() + "/System/Library/PlugIns/Target.bundle";
  writePlugIn(target, "com.example.target");
  std::filesystem::create_directories(daemon_.root() + "/links");
  std::filesystem::create_directory_symlink(target, daemon_.root() + "/links/Link.bundle");
  ASSERT_EQ(tnctl({"add", daemon_.root() + "/links/Link.bundle"}).exitStatus, 0);
  const auto found = tnctl({"find", "--url", "file://" + target});
  EXPECT_EQ(found.exitStatus, 0) << found.err;
  EXPECT_NE(found.out.find("com.example.target"), std::string::npos) << found.out;
  EXPECT_NE(registryListing().find(target), std::string::npos);

  // Relative paths and links to nowhere get the path errors.
  const auto relative = tnctl({"request", R"({"request":"add","version":3,"paths":["relative/X.bundle"]})"});
  EXPECT_EQ(relative.exitStatus, 1);
  EXPECT_NE(relative.err.find("tnctl: error 9: "), std::string::npos) << relative.err;
  std::filesystem::create_directory_symlink(daemon_.root() + "/nowhere", daemon_.root() + "/links/Dangling.bundle");
  EXPECT_EQ(tnctl({"add", daemon_.root() + "/links/Dangling.bundle"}).err,
            "tnctl: error 9: invalid plugin path: " + daemon_.root() + "/links/Dangling.bundle\n");

  // A directory that is no bundle is refused by the registrar; tnctl says
  // why, as its lint finds it.
  const std::string empty = daemon_.root() + "/empty.bundle";
  std::filesystem::create_directories(empty);
  const auto refused = tnctl({"add", empty});
  EXPECT_EQ(refused.err, "tnctl: error 2: unable to register plug-in at " + empty + "\ntnctl: " + empty + ": " +
                             empty + "/Info.manifest: cannot read: No such file or directory\n");
  EXPECT_NE(daemon_.log().find("failed to register plug-in at " + daemon_.root() + "/empty.bundle"),
            std::string::npos);
}

TEST_F(Registration, RemoveNeedsTheManagerEntitlement) {
  const std::string bundle = daemon_.root() + "/System/Library/PlugIns/Removable.bundle";
  writePlugIn(bundle, "com.example.removable");
  ASSERT_EQ(tnctl({"add", bundle}).exitStatus, 0);

  const auto refused = tnctl({"remove", bundle});
  EXPECT_EQ(refused.exitStatus, 1);
  EXPECT_EQ(refused.err, "tnctl: error 11: caller lacks entitlement for this operation\n");
  EXPECT_NE(daemon_.log().find("to remove plug-in at " + bundle + " - client lacks required entitlement"),
            std::string::npos);
  EXPECT_NE(registryListing().find("com.example.removable"), std::string::npos);
  EXPECT_EQ(tnctl({"request", R"({"request":"remove","version":3,"paths":[]})"}).exitStatus, 0)
      << "no paths: nothing to refuse";

  grantManagerEntitlement();
  EXPECT_EQ(tnctl({"remove", bundle}).exitStatus, 0) << daemon_.log();
  EXPECT_EQ(registryListing().find("com.example.removable"), std::string::npos);
  const auto gone = tnctl({"remove", bundle});
  EXPECT_EQ(gone.err, "tnctl: error 9: no plugin at " + bundle + "\n");
}

TEST_F(Registration, BulkSucceedsAndSaysItSupportsNothing) {
  EXPECT_EQ(tnctl({"bulk"}).exitStatus, 0);
  EXPECT_EQ(tnctl({"bulk", "--flags", "255"}).exitStatus, 0);
  EXPECT_TRUE(daemonLogs("bulk options 0x0 not supported"));
  EXPECT_TRUE(daemonLogs("bulk options 0xff not supported"));
}

TEST_F(Registration, AnApplicationCopiedIntoARootIsInstalledWhileTheDaemonRuns) {
  const std::string staging = daemon_.root() + "/staging/Viewer";
  makeBundle(staging, R"({"BNBundleIdentifier": "com.example.viewer"})");
  writePlugIn(staging + "/Support/PlugIns/Thumbs.bundle", "com.example.viewer.thumbs");
  const std::string applications = daemon_.root() + "/opt/tenon/applications";
  std::filesystem::create_directories(applications);
  std::filesystem::rename(staging, applications + "/Viewer");
  EXPECT_TRUE(daemonLogs("plug-in INSTALLED:com.example.viewer.thumbs com.example.viewer.thumbs(1)"))
      << daemon_.log();

  std::filesystem::remove_all(applications + "/Viewer");
  EXPECT_TRUE(daemonLogs("plug-in UNINSTALLED:com.example.viewer.thumbs")) << daemon_.log();
}

}  // namespace
}  // namespace tn::test
