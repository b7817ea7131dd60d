// The daemon and its registrar at start: a first start scans with its
// progress in the log; a warm start answers from the store and announces
// what changed while it was down as installs and uninstalls; an application
// renamed into a watched root is installed while it runs.

#include <gtest/gtest.h>

#include <chrono>
#include <filesystem>
#include <thread>

#include <fmt/format.h>

#include "tests/platform/bundle/BundleTestSupport.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/TempDirectory.h"

namespace tn::test {
namespace {

// Waits (up to 10 s) until the daemon's log holds text.
bool logShows(const DaemonProcess& daemon, const std::string& text) {
  for (int i = 0; i < 500; ++i) {
    if (daemon.log().find(text) != std::string::npos) return true;
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  return false;
}

// An application with one plug-in, built beside the root and renamed in.
void installApplication(const std::string& applications, const std::string& name) {
  const std::string staging = applications + "/../staging-" + name;
  makeBundle(staging, fmt::format(R"({{"BNBundleIdentifier": "com.example.{}"}})", name));
  makeBundle(staging + "/Support/PlugIns/P", fmt::format(R"({{"BNBundleIdentifier": "com.example.{0}.p",
      "XTExtension": {{"XTExtensionPointIdentifier": "com.example.point", "XTExtensionProtocol": "p"}}}})",
                                                       name));
  std::filesystem::rename(staging, applications + "/" + name);
}

TEST(RegistrarStart, AWarmStartAnnouncesWhatChangedWhileTheDaemonWasDown) {
  TempDirectory shared;
  const std::string applications = shared.path() + "/applications";
  makeDirectory(applications);
  const std::vector<std::string> environment = {"TENON_APP_DIRS=" + applications};
  installApplication(applications, "kept");
  installApplication(applications, "removed");

  DaemonProcess first(tenondBinaryPath(), {}, {}, environment);
  ASSERT_TRUE(first.accepting()) << first.log();
  EXPECT_TRUE(logShows(first, "scanned the application roots in")) << first.log();
  installApplication(applications, "live");
  ASSERT_TRUE(logShows(first, "plug-in INSTALLED:com.example.live.p")) << first.log();
  const std::string store = first.root() + "/var/lib/tenon/registrar.sqlite3";
  ASSERT_EQ(first.terminate(), 0) << first.log();

  std::filesystem::remove_all(applications + "/removed");
  installApplication(applications, "added");
  // The second daemon starts from the first one's store (the applications
  // are outside both roots, so its paths hold).
  DaemonProcess second(
      tenondBinaryPath(), {},
      [&](const std::string& root) {
        makeDirectory(root + "/var/lib/tenon");
        for (const char* suffix : {"", "-wal"}) {
          if (std::filesystem::exists(store + suffix)) {
            std::filesystem::copy_file(store + suffix, root + "/var/lib/tenon/registrar.sqlite3" + suffix);
          }
        }
      },
      environment);
  ASSERT_TRUE(second.accepting()) << second.log();
  EXPECT_TRUE(logShows(second, "plug-in UNINSTALLED:com.example.removed.p")) << second.log();
  EXPECT_TRUE(logShows(second, "plug-in INSTALLED:com.example.added.p")) << second.log();
  const std::string log = second.log();
  EXPECT_EQ(log.find("scanning the application roots"), std::string::npos) << "a warm start does not wait";
  EXPECT_EQ(log.find("INSTALLED:com.example.kept.p"), std::string::npos) << log;
  EXPECT_EQ(log.find("INSTALLED:com.example.live.p"), std::string::npos) << log;
}

}  // namespace
}  // namespace tn::test
