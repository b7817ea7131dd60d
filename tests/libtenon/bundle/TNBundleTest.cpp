// TNBundle: the view over bundle objects: creators, the executable fallback
// for loose executables, the support-path cache, and the information
// dictionary with its log lines.

#include <gtest/gtest.h>

#include <unistd.h>

#include <filesystem>

#include "libtenon/model/TNBundle.h"
#include "platform/log/Log.h"
#include "tests/platform/bundle/BundleTestSupport.h"

namespace tn {
namespace {

using test::makeBundle;
using test::makeDirectory;
using test::TempDirectory;
using test::writeFile;

class TNBundleTest : public ::testing::Test {
 protected:
  void SetUp() override {
    log::configure("ops=info");
    app_ = root_ / "App";
    makeBundle(app_, R"({"BNBundleExecutable": "app", "BNBundleIdentifier": "com.example.app"})", "app");
  }
  void TearDown() override { log::configure(""); }

  TempDirectory root_;
  std::string app_;
  log::ScopedCaptureSink capture_;
};

TEST_F(TNBundleTest, CreatorsFromPathsAndURLs) {
  const auto byPath = TNBundle::withPath(app_);
  ASSERT_TRUE(byPath);
  EXPECT_EQ(byPath->path(), app_);
  EXPECT_EQ(byPath->url(), URL::fileURLWithPath(app_));
  EXPECT_EQ(byPath->executablePath(), app_ + "/bin/app");

  const auto byURL = TNBundle::withURL(URL::fileURLWithPath(app_));
  ASSERT_TRUE(byURL);
  EXPECT_EQ(byURL->path(), app_);

  const auto byExecutable = TNBundle::withExecutableURL(URL::fileURLWithPath(app_ + "/bin/app"));
  ASSERT_TRUE(byExecutable);
  EXPECT_EQ(byExecutable->path(), app_);

  EXPECT_FALSE(TNBundle::withURL(*URL::parse("https://example.com/App")));
  EXPECT_FALSE(TNBundle::withExecutableURL(*URL::parse("https://example.com/App/bin/app")));
  EXPECT_FALSE(TNBundle::withPath(root_ / "missing"));
  EXPECT_FALSE(TNBundle::withRelayBundle(nullptr));
}

TEST_F(TNBundleTest, LooseExecutableIsItsOwnBundle) {
  const std::string tool = root_ / "tools/tool";
  writeFile(tool, "", 0755);
  const auto bundle = TNBundle::withExecutablePath(tool);
  ASSERT_TRUE(bundle);
  EXPECT_EQ(bundle->path(), tool);
  EXPECT_EQ(bundle->executablePath(), tool);
  EXPECT_EQ(bundle->bundleIdentifier(), std::nullopt);
  // A loose executable that does not exist has no bundle at all.
  EXPECT_FALSE(TNBundle::withExecutablePath(root_ / "tools/missing"));
}

TEST_F(TNBundleTest, ExecutablePathFallsBackToTheBundlePath) {
  const std::string data = root_ / "Data.tnx";
  makeBundle(data, R"({"BNBundleIdentifier": "com.example.data"})");
  EXPECT_EQ(TNBundle::withPath(data)->executablePath(), data);
}

TEST_F(TNBundleTest, SupportPathIsRememberedOnlyOnceFound) {
  const auto bundle = TNBundle::withPath(app_);
  EXPECT_EQ(bundle->supportPath(), std::nullopt);
  EXPECT_EQ(bundle->plugInsPath(), std::nullopt);

  makeDirectory(app_ + "/Support");
  EXPECT_EQ(bundle->supportPath(), app_ + "/Support");
  EXPECT_EQ(bundle->plugInsPath(), app_ + "/Support/PlugIns");
  EXPECT_EQ(bundle->bundleDirectory("Helpers"), app_ + "/Support/Helpers");

  std::filesystem::remove_all(app_ + "/Support");
  EXPECT_EQ(bundle->supportPath(), app_ + "/Support");
  EXPECT_EQ(TNBundle::withPath(app_)->supportPath(), std::nullopt);
}

TEST_F(TNBundleTest, InfoDictionaryIsReadAnewEachTime) {
  const auto bundle = TNBundle::withPath(app_);
  EXPECT_EQ(*bundle->infoDictionary()["BNBundleIdentifier"].string(), "com.example.app");
  writeFile(app_ + "/Info.manifest", R"({"BNBundleIdentifier": "com.example.renamed", "Gone": null})");
  const Value info = bundle->infoDictionary();
  EXPECT_EQ(*info["BNBundleIdentifier"].string(), "com.example.renamed");
  EXPECT_FALSE(info.dictionary()->contains("Gone"));  // the conversion drops nulls
  EXPECT_EQ(bundle->bundleIdentifier(), "com.example.renamed");
  EXPECT_EQ(capture_->records().size(), 0U);
}

TEST_F(TNBundleTest, MissingInfoDictionaryIsLogged) {
  writeFile(app_ + "/Info.manifest", R"(["not", "a", "dictionary"])");
  const auto bundle = TNBundle::withPath(app_);
  EXPECT_TRUE(bundle->infoDictionary().isNull());
  EXPECT_EQ(bundle->bundleIdentifier(), std::nullopt);
  const std::string expected = "failed to retrieve Info.manifest for " + app_ + " through " +
                               bundle->relayBundle()->description();
  EXPECT_EQ(capture_->count("ops", log::Level::Info, expected), 1U);
}

TEST_F(TNBundleTest, BundleIdentifierMustBeAString) {
  writeFile(app_ + "/Info.manifest", R"({"BNBundleIdentifier": 42})");
  EXPECT_EQ(TNBundle::withPath(app_)->bundleIdentifier(), std::nullopt);
  std::filesystem::remove(app_ + "/Info.manifest");
  EXPECT_EQ(TNBundle::withPath(app_)->bundleIdentifier(), std::nullopt);
}

TEST(TNBundleMain, IsTheBundleOfThisProgram) {
  const auto main = TNBundle::forMainBundle();
  ASSERT_TRUE(main);
  EXPECT_EQ(main->relayBundle(), bundle::Bundle::mainBundle());
}

}  // namespace
}  // namespace tn
