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

  test::ProcessResult lint(const std::string& bundle, bool json = false, std::vector<std::string> more = {}) {
    std::vector<std::string> argv{kTnctl, "lint", bundle};
    if (json) argv.push_back("--json");
    argv.insert(argv.end(), more.begin(), more.end());
    return test::runProcess(argv, {"TENON_ROOT=" + root_.path()});
  }

  // A plug-in of the registered extension point with `plugIn` as its
  // XTExtension entries after the point's identifier, and an executable.
  std::string shareBundle(const std::string& name, const std::string& plugIn, const std::string& top = "") {
    const std::string bundle = root_ / name;
    test::makeBundle(bundle,
                     R"({"BNBundleIdentifier": "com.example.)" + name + R"(", "BNBundleExecutable": "run", )" + top +
                         R"("XTExtension": {"XTExtensionPointIdentifier": "com.example.share")" +
                         (plugIn.empty() ? "" : ", " + plugIn) + "}}",
                     "run");
    return bundle;
  }

  test::TempDirectory root_;
};

TEST_F(TnctlLintTest, AGoodBundleIsOkWithItsSDKMerged) {
  const std::string bundle = root_ / "Apps/Mail/Support/PlugIns/Share.tnx";
  test::makeBundle(bundle, R"({"BNBundleIdentifier": "com.example.mail.share", "BNBundleShortVersionString": "2.1",
      "BNBundleExecutable": "share",
      "XTExtension": {"XTExtensionPointIdentifier": "com.example.share", "XTExtensionAttributes": {"A": 1}}})",
                   "share");
  const test::ProcessResult readable = lint(bundle);
  EXPECT_EQ(readable.exitStatus, 0) << readable.err;
  EXPECT_EQ(readable.err, "");
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

  // The manifest itself names the same bundle.
  const test::ProcessResult manifest = lint(bundle + "/Info.manifest");
  EXPECT_EQ(manifest.exitStatus, 0) << manifest.err;
  EXPECT_EQ(manifest.out, readable.out);
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

  // An unregistered extension point is the error, not the keys its SDK
  // would have supplied; --extension-points names where it is.
  const std::string unregistered = root_ / "Unregistered";
  test::makeBundle(unregistered, R"({"BNBundleIdentifier": "x", "BNBundleExecutable": "x",
      "XTExtension": {"XTExtensionPointIdentifier": "com.example.unknown", "XTExtensionAttributes": {}}})", "x");
  const test::ProcessResult missing = lint(unregistered);
  EXPECT_EQ(missing.exitStatus, 1);
  EXPECT_EQ(missing.err, "tnctl: " + unregistered + ": extension point \"com.example.unknown\" "
                         "(\"XTExtensionPointIdentifier\") is not registered; --extension-points DIR names where its "
                         "definition is\n");

  const std::string points = root_ / "points";
  test::writeFile(points + "/com.example.unknown.manifest", R"({"XTExtension": {"XTExtensionProtocol": "p"}})");
  const test::ProcessResult found = lint(unregistered, false, {"--extension-points", points});
  EXPECT_EQ(found.exitStatus, 0) << found.err;
  EXPECT_NE(found.out.find("protocol: p\n"), std::string::npos) << found.out;
}

TEST_F(TnctlLintTest, KeysOfTheWrongTypeAreNamedAsSuchNotAsMissing) {
  const test::ProcessResult attributes = lint(shareBundle("Listed", R"("XTExtensionAttributes": ["A"])"));
  EXPECT_EQ(attributes.exitStatus, 1);
  EXPECT_EQ(attributes.err, "tnctl: " + (root_ / "Listed") + ": \"XTExtensionAttributes\" in XTExtension has the "
                            "wrong type: an array where a dictionary is needed\n");

  const test::ProcessResult identifier = lint(shareBundle("Numbered", R"("XTExtensionIdentifier": 7)"));
  EXPECT_EQ(identifier.exitStatus, 1);
  EXPECT_NE(identifier.err.find("\"XTExtensionIdentifier\" in XTExtension has the wrong type: a number where a "
                                "string is needed"), std::string::npos) << identifier.err;
  EXPECT_EQ(identifier.err.find("missing"), std::string::npos) << identifier.err;

  const std::string plugInString = root_ / "Flat";
  test::makeBundle(plugInString, R"({"BNBundleIdentifier": "x", "XTExtension": "com.example.share"})");
  const test::ProcessResult flat = lint(plugInString, true);
  EXPECT_EQ(flat.exitStatus, 1);
  Result<Value> report = readDocument(flat.out, "stdout");
  ASSERT_TRUE(report) << flat.out;
  EXPECT_EQ((*report)["error"], Value("\"XTExtension\" in Info.manifest has the wrong type: a string where a "
                                      "dictionary is needed"));
  EXPECT_EQ((*report)["findings"].array()->size(), 1u) << flat.out;
}

TEST_F(TnctlLintTest, MisspelledKeysNameTheIntendedOneAndUnknownKeysAreWarned) {
  const test::ProcessResult misspelled =
      lint(shareBundle("Typo", R"("XTExtensionProtocl": "p", "XTExtensionAttributes": {"XTExtensionVersoin": "2"})"));
  EXPECT_EQ(misspelled.exitStatus, 1);
  EXPECT_NE(misspelled.err.find("unknown key \"XTExtensionProtocl\" in XTExtension; did you mean "
                                "\"XTExtensionProtocol\"?"), std::string::npos) << misspelled.err;
  EXPECT_NE(misspelled.err.find("unknown key \"XTExtensionVersoin\" in XTExtensionAttributes; did you mean "
                                "\"XTExtensionVersion\"?"), std::string::npos) << misspelled.err;

  const test::ProcessResult misplaced = lint(shareBundle("Misplaced", "", R"("XTExtensionProtocol": "p", )"));
  EXPECT_NE(misplaced.err.find("\"XTExtensionProtocol\" belongs in XTExtension, not in Info.manifest"),
            std::string::npos) << misplaced.err;

  // A key of the author's own is not an error, but is pointed out; an
  // attribute of the author's own is neither.
  const test::ProcessResult own =
      lint(shareBundle("Own", R"("XTExtensionAttributes": {"Colour": "red"})", R"("CompanyLogo": "logo.png", )"));
  EXPECT_EQ(own.exitStatus, 0) << own.err;
  EXPECT_EQ(own.err, "tnctl: " + (root_ / "Own") +
                         ": warning: unknown key \"CompanyLogo\" in Info.manifest is not read by the system\n");
}

TEST_F(TnctlLintTest, AttributesNoRuleCouldMatchAreErrors) {
  const test::ProcessResult mixed = lint(shareBundle("Mixed", R"("XTExtensionAttributes": {"Types": ["a", 2]})"));
  EXPECT_EQ(mixed.exitStatus, 1);
  EXPECT_NE(mixed.err.find("attribute \"Types\" has a number at index 1"), std::string::npos) << mixed.err;

  const test::ProcessResult rule = lint(shareBundle("Rule", R"("XTExtensionAttributes": {"Accepts": {"frob": 1}})"));
  EXPECT_EQ(rule.exitStatus, 1);
  EXPECT_NE(rule.err.find("attribute \"Accepts\" is a dictionary but not a valid activation rule"),
            std::string::npos) << rule.err;

  const test::ProcessResult open =
      lint(shareBundle("Open", R"("XTExtensionAttributes": {"RequestsOpenAccess": "yes"})"));
  EXPECT_NE(open.err.find("\"RequestsOpenAccess\" in XTExtensionAttributes has the wrong type: a string where a "
                          "boolean is needed"), std::string::npos) << open.err;

  const test::ProcessResult good = lint(shareBundle(
      "Good", R"("XTExtensionAttributes": {"Types": ["a"], "On": true, "N": 2,
                 "XTExtensionActivationRule": {"accepts": {"image/*": 3}}})"));
  EXPECT_EQ(good.exitStatus, 0) << good.err;
}

TEST_F(TnctlLintTest, APlugInThatRunsNeedsAnExecutableFile) {
  const std::string none = root_ / "NoExecutable";
  test::makeBundle(none, R"({"BNBundleIdentifier": "x",
      "XTExtension": {"XTExtensionPointIdentifier": "com.example.share"}})");
  EXPECT_NE(lint(none).err.find("missing \"BNBundleExecutable\" key: a plug-in that is not data-only"),
            std::string::npos);

  const std::string absent = shareBundle("Absent", "");
  std::filesystem::remove(absent + "/bin/run");
  EXPECT_NE(lint(absent).err.find("the executable bin/run named by \"BNBundleExecutable\" does not exist"),
            std::string::npos);

  const std::string plain = shareBundle("Plain", "");
  std::filesystem::permissions(plain + "/bin/run", std::filesystem::perms(0644));
  const test::ProcessResult notExecutable = lint(plain);
  EXPECT_EQ(notExecutable.exitStatus, 1);
  EXPECT_NE(notExecutable.err.find("the executable bin/run is not executable (mode 0644)"), std::string::npos)
      << notExecutable.err;

  // A data-only plug-in runs nothing.
  const std::string data = root_ / "Data";
  test::makeBundle(data, R"({"BNBundleIdentifier": "x",
      "XTExtension": {"XTExtensionProtocol": "#Data", "XTExtensionAttributes": {}}})");
  EXPECT_EQ(lint(data).exitStatus, 0);
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
