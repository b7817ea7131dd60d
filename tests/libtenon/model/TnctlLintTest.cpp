// tnctl lint, run as a plug-in author runs it: the real binary on bundles
// built on disk, with extension-point SDKs under a private TENON_ROOT; and
// the registry lookup behind it, with its language fallback for action
// titles.

#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>

#include "libtenon/model/TNPlugInCore.h"
#include "platform/value/Document.h"
#include "tests/platform/bundle/BundleTestSupport.h"
#include "tests/support/Subprocess.h"
#include "tools/tnctl/RegistryLookup.h"

namespace tn {
namespace {

const std::string kTnctl = std::string(TENON_BINARY_DIR "/tools/tnctl/tnctl");

class TnctlLintTest : public ::testing::Test {
 protected:
  void SetUp() override {
    test::writeFile(root_ / "usr/share/tenon/extension-points/com.example.share.manifest",
                    R"({"XTExtension": {"XTExtensionProtocol": "com.example.share-protocol",
                        "XTExtensionAttributes": {"A": 2, "B": 3}, "CleanTimeout": 5}})");
  }

  test::ProcessResult lint(const std::string& bundle, bool json = false) {
    std::vector<std::string> argv{kTnctl, "lint", bundle};
    if (json) argv.push_back("--json");
    return test::runProcess(argv, {"TENON_ROOT=" + root_.path()});
  }

  test::TempDirectory root_;
};

TEST_F(TnctlLintTest, AGoodBundleIsOkWithItsSDKMerged) {
  const std::string bundle = root_ / "Apps/Mail/Support/PlugIns/Share.tnx";
  test::makeBundle(bundle, R"({"BNBundleIdentifier": "com.example.mail.share", "BNBundleShortVersionString": "2.1",
      "XTExtension": {"XTExtensionPointIdentifier": "com.example.share", "XTExtensionAttributes": {"A": 1}}})");
  const test::ProcessResult readable = lint(bundle);
  EXPECT_EQ(readable.exitStatus, 0) << readable.err;
  EXPECT_EQ(readable.out,
            "ok\nidentifier: com.example.mail.share\nversion: 2.1\nprotocol: com.example.share-protocol\n"
            "attributes: {A: 1, B: 3, XTExtensionVersion: \"2.1\"}\n");

  const test::ProcessResult json = lint(bundle, true);
  ASSERT_EQ(json.exitStatus, 0) << json.err;
  Result<Value> report = readDocument(json.out, "stdout");
  ASSERT_TRUE(report) << json.out;
  EXPECT_EQ((*report)["ok"], Value(true));
  EXPECT_EQ((*report)["identifier"], Value("com.example.mail.share"));
  EXPECT_EQ((*report)["attributes"], Value(Dictionary{{"A", 1}, {"B", 3}, {"XTExtensionVersion", "2.1"}}));
}

TEST_F(TnctlLintTest, ABrokenBundleGivesTheDiagnosis) {
  const std::string hybrid = root_ / "Hybrid.tnx";
  test::makeBundle(hybrid, R"({"BNBundleIdentifier": "com.example.hybrid",
      "XTExtension": {"XTExtensionAttributes": {}, "EmbeddedCode": true}})");
  const test::ProcessResult result = lint(hybrid);
  EXPECT_EQ(result.exitStatus, 1);
  EXPECT_EQ(result.out, "");
  EXPECT_EQ(result.err, "tnctl: " + hybrid + ": hybrid plug-ins are not supported on this platform\n");

  const std::string anonymous = root_ / "Anonymous";
  test::makeBundle(anonymous, R"({"XTExtension": {"XTExtensionProtocol": "p", "XTExtensionAttributes": {}}})");
  const test::ProcessResult json = lint(anonymous, true);
  EXPECT_EQ(json.exitStatus, 1);
  Result<Value> report = readDocument(json.out, "stdout");
  ASSERT_TRUE(report) << json.out;
  EXPECT_EQ((*report)["ok"], Value(false));
  EXPECT_EQ((*report)["errorcode"], Value(12));
  EXPECT_EQ((*report)["error"], Value("missing identifier (no XTExtensionIdentifier, nor even BNBundleIdentifier)"));

  // Without its SDK the same plug-in misses what the SDK would give it.
  const std::string unregistered = root_ / "Unregistered";
  test::makeBundle(unregistered, R"({"BNBundleIdentifier": "x",
      "XTExtension": {"XTExtensionPointIdentifier": "com.example.unknown", "XTExtensionAttributes": {}}})");
  const test::ProcessResult missing = lint(unregistered);
  EXPECT_EQ(missing.exitStatus, 1);
  EXPECT_NE(missing.err.find("extension point \"com.example.unknown\" is not registered"), std::string::npos);
  EXPECT_NE(missing.err.find("missing \"XTExtensionProtocol\" key in Info.manifest or SDK"), std::string::npos);
}

TEST_F(TnctlLintTest, BundlesWithoutAPlugInDictionaryOrManifestAreRefused) {
  const std::string old = root_ / "Old";
  test::makeBundle(old, R"({"BNBundleIdentifier": "x", "Tenon": {}})");
  const test::ProcessResult oldStyle = lint(old);
  EXPECT_EQ(oldStyle.exitStatus, 1);
  EXPECT_NE(oldStyle.err.find("old-style plug-in"), std::string::npos) << oldStyle.err;

  const std::string broken = root_ / "Broken";
  test::makeBundle(broken, R"({"XTExtension": )");
  const test::ProcessResult unreadable = lint(broken);
  EXPECT_EQ(unreadable.exitStatus, 1);
  EXPECT_NE(unreadable.err.find("Info.manifest"), std::string::npos) << unreadable.err;

  EXPECT_EQ(lint(root_ / "absent").exitStatus, 1);
}

// The registry lookup tnctl uses, in this process, on a private root.
class ManifestLookupTest : public ::testing::Test {
 protected:
  static constexpr const char* kVariables[] = {"LC_ALL", "LC_MESSAGES", "LANG", "TENON_ROOT"};

  void SetUp() override {
    for (const char* variable : kVariables) {
      if (const char* value = std::getenv(variable)) saved_.emplace_back(variable, value);
      ::unsetenv(variable);
    }
    ::setenv("TENON_ROOT", root_.path().c_str(), 1);
    bundle_ = root_ / "Files.tnx";
    test::writeFile(bundle_ + "/Localized/de_AT/Localizable.manifest", R"({"Open": "Aufmachen"})");
    test::writeFile(bundle_ + "/Localized/de/Localizable.manifest", R"({"Open": "Öffnen", "Share": "Teilen"})");
    test::writeFile(bundle_ + "/Localized/Base/Localizable.manifest", R"({"Share": "Share it", "Print": "Print it"})");
  }
  void TearDown() override {
    for (const char* variable : kVariables) ::unsetenv(variable);
    for (const auto& [variable, value] : saved_) ::setenv(variable.c_str(), value.c_str(), 1);
  }

  Dictionary titles() {
    const Dictionary plugIn{{"XTExtensionFileSourceActions",
                             Array{Dictionary{{"XTExtensionFileSourceActionName", "Open"}},
                                   Dictionary{{"XTExtensionFileSourceActionName", "Share"}},
                                   Dictionary{{"XTExtensionFileSourceActionName", "Print"}},
                                   Dictionary{{"XTExtensionFileSourceActionName", "Delete"}}}}};
    return localizedFileSourceActionNamesForTNDict(*tnctl::makeRegistryLookup(), URL::fileURLWithPath(bundle_),
                                                   Value(plugIn), bundle_);
  }

  test::TempDirectory root_;
  std::string bundle_;
  std::vector<std::pair<std::string, std::string>> saved_;
};

TEST_F(ManifestLookupTest, ActionTitlesFallBackFromRegionToLanguageToBase) {
  ::setenv("LANG", "de_AT.UTF-8", 1);
  EXPECT_EQ(titles(), (Dictionary{{"Open", "Aufmachen"}, {"Share", "Teilen"}, {"Print", "Print it"}, {"Delete", "Delete"}}));

  ::setenv("LANG", "de_CH.UTF-8", 1);  // no table for the region: the language's
  EXPECT_EQ(titles().get("Open"), Value("Öffnen"));

  ::setenv("LANG", "fr_FR.UTF-8", 1);
  EXPECT_EQ(titles(), (Dictionary{{"Open", "Open"}, {"Share", "Share it"}, {"Print", "Print it"}, {"Delete", "Delete"}}));

  std::filesystem::remove_all(bundle_ + "/Localized/Base");
  EXPECT_EQ(titles().get("Share"), Value("Share"));
}

TEST_F(ManifestLookupTest, SDKDictionariesComeFromTheRootAndRefuseOddNames) {
  test::writeFile(root_ / "usr/share/tenon/extension-points/com.example.p.manifest", R"({"XTExtension": {"A": 1}})");
  test::writeFile(root_ / "usr/share/tenon/extension-points/com.example.list.manifest", R"([1, 2])");
  test::writeFile(root_ / "usr/share/tenon/secret.manifest", R"({"leaked": true})");
  const auto lookup = tnctl::makeRegistryLookup();
  EXPECT_EQ(lookup->sdkDictionary("com.example.p"), (Dictionary{{"XTExtension", Dictionary{{"A", 1}}}}));
  EXPECT_FALSE(lookup->sdkDictionary("com.example.absent"));
  EXPECT_FALSE(lookup->sdkDictionary("com.example.list"));
  EXPECT_FALSE(lookup->sdkDictionary("../secret"));
  EXPECT_FALSE(lookup->sdkDictionary(""));
}

}  // namespace
}  // namespace tn
