// What the supervisor reads: sandbox profiles, activation overlays and the
// credentials lines of /proc/<pid>/status. Every refusal names what is at
// fault.

#include <gtest/gtest.h>

#include <linux/seccomp.h>

#include <fstream>

#include "platform/value/Document.h"
#include "platform/warden/ActivationOverlay.h"
#include "platform/warden/ProcessHandle.h"
#include "platform/warden/SandboxProfile.h"
#include "platform/warden/SeccompProgram.h"
#include "tests/support/TempDirectory.h"

namespace warden {
namespace {

tn::Value json(const std::string& text) { return *tn::readDocument(text, "test"); }

std::string refusal(const tn::Result<SandboxProfile>& result) {
  return result.ok() ? std::string("accepted") : result.error().localizedDescription();
}

TEST(SandboxProfile, ReadsPathsAndDeniedCalls) {
  const auto profile = SandboxProfile::fromDocument(
      json(R"({"version": 1, "read-only": ["/usr"], "read-write": ["/dev/null"], "deny-system-calls": ["ptrace"]})"),
      "plugin", "/p/plugin.manifest");
  ASSERT_TRUE(profile.ok()) << profile.error().description();
  EXPECT_EQ(profile->readOnly, std::vector<std::string>{"/usr"});
  EXPECT_EQ(profile->readWrite, std::vector<std::string>{"/dev/null"});
  EXPECT_EQ(profile->deniedSystemCalls, std::vector<std::string>{"ptrace"});
}

TEST(SandboxProfile, RefusesWhatItDoesNotUnderstandNamingTheFile) {
  const std::vector<std::pair<std::string, std::string>> cases = {
      {R"([1])", "not a dictionary"},
      {R"({"version": 2})", "\"version\" is not 1"},
      {R"({"version": 1, "network": true})", "unknown key \"network\""},
      {R"({"version": 1, "read-only": ["usr"]})", "not an absolute path"},
      {R"({"version": 1, "read-write": "/tmp"})", "\"read-write\" is not an array"},
      {R"({"version": 1, "deny-system-calls": ["launch_missiles"]})", "no known system call"},
  };
  for (const auto& [text, reason] : cases) {
    const std::string message = refusal(SandboxProfile::fromDocument(json(text), "plugin", "/p/plugin.manifest"));
    EXPECT_NE(message.find("/p/plugin.manifest"), std::string::npos) << message;
    EXPECT_NE(message.find(reason), std::string::npos) << text << " gave: " << message;
  }
}

TEST(SandboxProfile, LoadsFromTheRootAndNamesAMissingFile) {
  const tn::test::TempRoot root;
  std::filesystem::create_directories(SandboxProfile::directory());
  std::ofstream(SandboxProfile::pathOf("plugin")) << R"({"version": 1, "read-only": ["/usr"]})";
  EXPECT_TRUE(SandboxProfile::load("plugin").ok());
  const auto missing = SandboxProfile::load("glanced");
  ASSERT_FALSE(missing.ok());
  EXPECT_EQ(missing.error().code(), ENOENT);
  EXPECT_NE(missing.error().localizedDescription().find(SandboxProfile::pathOf("glanced")), std::string::npos);
  // A name can never leave the profiles directory.
  EXPECT_EQ(SandboxProfile::load("../etc/passwd").error().code(), EINVAL);
  EXPECT_FALSE(isProfileName("Plugin"));
  EXPECT_FALSE(isProfileName(""));
}

TEST(SandboxProfile, ShippedProfilesAllParse) {
  for (const char* name : {"plugin", "entry-pad", "traffic-screen", "glanced", "glance-view", "glance-miniature",
                           "sketchpad-tools", "note-sieve"}) {
    const std::string path = std::string(TENON_SOURCE_DIR "/packaging/sandbox-profiles/") + name + ".manifest";
    const auto document = tn::readDocumentFile(path);
    ASSERT_TRUE(document.ok()) << path;
    EXPECT_TRUE(SandboxProfile::fromDocument(*document, name, path).ok()) << refusal(
        SandboxProfile::fromDocument(*document, name, path));
  }
}

TEST(SeccompProgram, DeniesEachNamedCallAndEndsInAllow) {
  const auto plain = buildSeccompProgram({});
  const auto denying = buildSeccompProgram({"ptrace", "mount"});
  EXPECT_EQ(denying.size(), plain.size() + 4);  // a compare and a return per call
  EXPECT_EQ(denying.back().k, static_cast<uint32_t>(SECCOMP_RET_ALLOW));
  EXPECT_TRUE(isKnownSystemCall("bpf"));
  EXPECT_FALSE(isKnownSystemCall("read"));  // not deniable: every program needs it
}

tn::Value overlayWith(tn::Dictionary service, const char* packageType = "RLY!") {
  return tn::Dictionary{{"RelayService", std::move(service)}, {"BNBundlePackageType", packageType}};
}

TEST(ActivationOverlay, TakesTheEnvironmentAndProfile) {
  const auto overlay = ActivationOverlay::parse(overlayWith(
      {{"EnvironmentVariables", tn::Dictionary{{"HOME", "/c"}, {"TMPDIR", "/c/tmp"}}}, {"_SandboxProfile", "glanced"},
       {"_OmitSandboxParameters", true}}));
  ASSERT_TRUE(overlay.ok()) << overlay.error().description();
  EXPECT_EQ(overlay->environment.size(), 2u);
  EXPECT_EQ(overlay->environment[1], std::make_pair(std::string("TMPDIR"), std::string("/c/tmp")));
  EXPECT_EQ(overlay->sandboxProfile, "glanced");
  EXPECT_EQ(ActivationOverlay::parse(overlayWith({}))->sandboxProfile, "plugin");
}

TEST(ActivationOverlay, RefusesMalformedOverlays) {
  const std::vector<std::pair<tn::Value, std::string>> cases = {
      {overlayWith({}, "APPL"), "BNBundlePackageType"},
      {tn::Dictionary{{"BNBundlePackageType", "RLY!"}}, "\"RelayService\" is not a dictionary"},
      {overlayWith({{"EnvironmentVariables", tn::Dictionary{{"A=B", "x"}}}}), "is not valid"},
      {overlayWith({{"EnvironmentVariables", tn::Dictionary{{"A", 1}}}}), "is not a string"},
      {overlayWith({{"_SandboxProfile", "../../x"}}), "not a profile name"},
  };
  for (const auto& [value, reason] : cases) {
    const auto parsed = ActivationOverlay::parse(value);
    ASSERT_FALSE(parsed.ok()) << value;
    EXPECT_EQ(parsed.error().code(), EINVAL);
    EXPECT_NE(parsed.error().localizedDescription().find(reason), std::string::npos)
        << parsed.error().localizedDescription();
  }
}

TEST(StatusCredentials, TakesTheEffectiveIdsAndGroups) {
  const auto credentials =
      parseStatusCredentials("Name:\tx\nUid:\t1000\t1001\t1002\t1003\nGid:\t100\t101\t102\t103\nGroups:\t4 27 \n");
  ASSERT_TRUE(credentials);
  EXPECT_EQ(credentials->uid, 1001u);
  EXPECT_EQ(credentials->gid, 101u);
  EXPECT_EQ(credentials->groups, (std::vector<gid_t>{4, 27}));
  EXPECT_FALSE(parseStatusCredentials("Uid:\t1\t2\nGid:\t1\t1\t1\t1\nGroups:\n"));
  EXPECT_FALSE(parseStatusCredentials("Uid:\t1\t1\t1\t1\nGroups:\n"));
}

}  // namespace
}  // namespace warden
