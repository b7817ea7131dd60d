// Bundle objects: how they are found from a path or an executable, their
// numbered properties, and that hostile bundles only make properties absent.

#include <gtest/gtest.h>

#include <limits.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include "platform/bundle/Bundle.h"
#include "platform/bundle/BundlePaths.h"
#include "platform/value/Document.h"
#include "tests/platform/bundle/BundleTestSupport.h"

namespace bundle {
namespace {

using tn::test::makeBundle;
using tn::test::makeDirectory;
using tn::test::TempDirectory;
using tn::test::writeFile;

class BundleTest : public ::testing::Test {
 protected:
  TempDirectory root_;
};

TEST_F(BundleTest, BundlePathModeTakesAnythingThatExists) {
  const std::string app = root_ / "App";
  makeBundle(app, R"({"BNBundleExecutable": "app"})", "app");

  const auto bundle = Bundle::create(app + "/bin/../", CreateMode::BundlePath);
  ASSERT_TRUE(bundle);
  EXPECT_EQ(bundle->bundlePath(), app);
  EXPECT_EQ(bundle->property(kBundlePathProperty), app);

  // A loose file is its own bundle, without a manifest.
  const auto loose = Bundle::create(app + "/bin/app", CreateMode::BundlePath);
  ASSERT_TRUE(loose);
  EXPECT_EQ(loose->bundlePath(), app + "/bin/app");
  EXPECT_EQ(loose->executablePath(), std::nullopt);
  EXPECT_TRUE(loose->infoDictionary().isNull());

  EXPECT_FALSE(Bundle::create(root_ / "missing", CreateMode::BundlePath));
  EXPECT_FALSE(Bundle::create("", CreateMode::BundlePath));
  EXPECT_FALSE(Bundle::create("", CreateMode::ExecutablePath));
}

TEST_F(BundleTest, RelativePathsAreTakenAgainstTheCurrentDirectory) {
  makeBundle(root_ / "App", "{}");
  const std::filesystem::path previous = std::filesystem::current_path();
  std::filesystem::current_path(root_.path());
  const auto bundle = Bundle::create("./App/", CreateMode::BundlePath);
  std::filesystem::current_path(previous);
  ASSERT_TRUE(bundle);
  EXPECT_EQ(bundle->bundlePath(), root_ / "App");
}

TEST_F(BundleTest, ExecutableModeFindsTheNearestEnclosingBundle) {
  const std::string app = root_ / "App";
  const std::string plugIn = app + "/Support/PlugIns/Filter.tnx";
  makeBundle(app, R"({"BNBundleExecutable": "app"})", "app");
  makeBundle(plugIn, R"({"BNBundleExecutable": "filter"})", "filter");

  EXPECT_EQ(Bundle::create(app + "/bin/app", CreateMode::ExecutablePath)->bundlePath(), app);
  EXPECT_EQ(Bundle::create(plugIn + "/bin/filter", CreateMode::ExecutablePath)->bundlePath(), plugIn);
  // The executable need not exist, nor be directly in bin/.
  EXPECT_EQ(Bundle::create(app + "/Support/tools/x/helper", CreateMode::ExecutablePath)->bundlePath(), app);
}

TEST_F(BundleTest, ExecutableOutsideEveryBundleHasNoBundlePath) {
  writeFile(root_ / "bin/tool", "", 0755);
  const auto bundle = Bundle::create(root_ / "bin/tool", CreateMode::ExecutablePath);
  ASSERT_TRUE(bundle);
  EXPECT_EQ(bundle->bundlePath(), std::nullopt);
  EXPECT_EQ(bundle->property(kExecutablePathProperty), std::nullopt);
  EXPECT_EQ(bundle->property(kSupportFilesDirectoryProperty), std::nullopt);
  const tn::Result<tn::Value> info = bundle->readInfoDictionary();
  ASSERT_FALSE(info);
  EXPECT_EQ(info.error().code(), static_cast<int64_t>(BundleErrorCode::NoBundleDirectory));
  EXPECT_NE(bundle->description().find(root_ / "bin/tool"), std::string::npos);
}

TEST_F(BundleTest, DanglingManifestLinkStillMarksTheBundle) {
  const std::string app = root_ / "App";
  makeDirectory(app + "/bin");
  ASSERT_EQ(::symlink("/nonexistent/Info.manifest", (app + "/Info.manifest").c_str()), 0);
  makeBundle(root_.path(), R"({"BNBundleExecutable": "x"})");  // an outer bundle must not be used

  const auto bundle = Bundle::create(app + "/bin/x", CreateMode::ExecutablePath);
  EXPECT_EQ(bundle->bundlePath(), app);
  EXPECT_EQ(bundle->executablePath(), std::nullopt);
  EXPECT_TRUE(bundle->infoDictionary().isNull());
}

TEST_F(BundleTest, PropertiesOfACompleteBundle) {
  const std::string app = root_ / "App";
  makeBundle(app, R"({"BNBundleExecutable": "app", "BNBundleIdentifier": "com.example.app"})", "app");
  makeDirectory(app + "/Support/PlugIns");
  const auto bundle = Bundle::create(app, CreateMode::BundlePath);

  EXPECT_EQ(bundle->property(kExecutablePathProperty), app + "/bin/app");
  EXPECT_EQ(bundle->property(kSupportFilesDirectoryProperty), app + "/Support");
  EXPECT_EQ(bundle->property(1), std::nullopt);
  EXPECT_EQ(bundle->property(-3), std::nullopt);
  EXPECT_EQ(*bundle->infoDictionary()["BNBundleIdentifier"].string(), "com.example.app");
}

TEST_F(BundleTest, PropertiesFollowTheDisk) {
  const std::string app = root_ / "App";
  makeBundle(app, R"({"BNBundleExecutable": "app"})");
  const auto bundle = Bundle::create(app, CreateMode::BundlePath);
  EXPECT_EQ(bundle->executablePath(), std::nullopt);  // named but missing
  EXPECT_EQ(bundle->supportFilesDirectory(), std::nullopt);

  writeFile(app + "/bin/app", "", 0755);
  makeDirectory(app + "/Support");
  EXPECT_EQ(bundle->executablePath(), app + "/bin/app");
  EXPECT_EQ(bundle->supportFilesDirectory(), app + "/Support");
}

TEST_F(BundleTest, DanglingExecutableLinkIsNoExecutable) {
  const std::string app = root_ / "App";
  makeBundle(app, R"({"BNBundleExecutable": "app"})");
  makeDirectory(app + "/bin");
  ASSERT_EQ(::symlink("/nonexistent/app", (app + "/bin/app").c_str()), 0);
  EXPECT_EQ(Bundle::create(app, CreateMode::BundlePath)->executablePath(), std::nullopt);
}

// Each manifest below must leave the bundle without an executable, and
// reading it must neither crash nor block.
class HostileManifest : public BundleTest, public ::testing::WithParamInterface<const char*> {};

TEST_P(HostileManifest, GivesNoExecutable) {
  const std::string app = root_ / "App";
  makeBundle(app, GetParam());
  writeFile(app + "/bin/app", "", 0755);
  writeFile(root_ / "outside", "", 0755);
  makeDirectory(app + "/bin/dir");
  const auto bundle = Bundle::create(app, CreateMode::BundlePath);
  EXPECT_EQ(bundle->executablePath(), std::nullopt);
}

INSTANTIATE_TEST_SUITE_P(
    Bundle, HostileManifest,
    ::testing::Values(R"({"BNBundleExecutable": "../../outside"})", R"({"BNBundleExecutable": ".."})",
                      R"({"BNBundleExecutable": "."})", R"({"BNBundleExecutable": "sub/app"})",
                      R"({"BNBundleExecutable": "/bin/sh"})", R"({"BNBundleExecutable": ""})",
                      R"({"BNBundleExecutable": "dir"})", R"({"BNBundleExecutable": 7})",
                      R"({"BNBundleExecutable": ["app"]})", R"(["BNBundleExecutable", "app"])",
                      R"("app")", R"({"BNBundleExecutable": "app")", "<map>", ""));

TEST_F(BundleTest, ManifestThatIsNotADictionaryIsReported) {
  const std::string app = root_ / "App";
  makeBundle(app, R"(["app"])");
  const tn::Result<tn::Value> info = Bundle::create(app, CreateMode::BundlePath)->readInfoDictionary();
  ASSERT_FALSE(info);
  EXPECT_EQ(info.error().domain(), kBundleErrorDomain);
  EXPECT_EQ(info.error().code(), static_cast<int64_t>(BundleErrorCode::NotADictionary));
}

TEST_F(BundleTest, ManifestThatIsAFifoIsRefusedWithoutBlocking) {
  const std::string app = root_ / "App";
  makeDirectory(app);
  ASSERT_EQ(::mkfifo((app + "/Info.manifest").c_str(), 0644), 0);
  const tn::Result<tn::Value> info = Bundle::create(app, CreateMode::BundlePath)->readInfoDictionary();
  ASSERT_FALSE(info);
  EXPECT_TRUE(tn::isDocumentError(info.error(), tn::DocumentErrorCode::Unreadable));
}

TEST_F(BundleTest, OversizedManifestIsRefused) {
  const std::string app = root_ / "App";
  makeDirectory(app);
  writeFile(app + "/Info.manifest", "");
  ASSERT_EQ(::truncate((app + "/Info.manifest").c_str(), static_cast<off_t>(tn::kMaxDocumentSize + 1)), 0);
  const tn::Result<tn::Value> info = Bundle::create(app, CreateMode::BundlePath)->readInfoDictionary();
  ASSERT_FALSE(info);
  EXPECT_TRUE(tn::isDocumentError(info.error(), tn::DocumentErrorCode::TooLarge));
}

TEST(MainBundle, IsTheBundleOfThisProgram) {
  char self[PATH_MAX];
  const ssize_t n = ::readlink("/proc/self/exe", self, sizeof self - 1);
  ASSERT_GT(n, 0);
  self[n] = '\0';
  const auto main = Bundle::mainBundle();
  ASSERT_TRUE(main);
  EXPECT_EQ(main, Bundle::mainBundle());
  EXPECT_NE(main->description().find(self), std::string::npos);
  EXPECT_EQ(main->bundlePath(), findEnclosingBundle(self));
}

TEST(BundlePaths, PlainFileNames) {
  EXPECT_TRUE(isPlainFileName("app"));
  EXPECT_TRUE(isPlainFileName("a..b"));
  EXPECT_TRUE(isPlainFileName(std::string(255, 'a')));
  EXPECT_FALSE(isPlainFileName(std::string(256, 'a')));
  EXPECT_FALSE(isPlainFileName(std::string("a\0b", 3)));
  EXPECT_FALSE(isPlainFileName(""));
}

TEST(BundlePaths, AbsolutePathsAreNormalised) {
  EXPECT_EQ(absoluteBundlePath("/a/./b//c/../"), "/a/b");
  EXPECT_EQ(absoluteBundlePath("/"), "/");
  EXPECT_EQ(absoluteBundlePath("/.."), "/");
  EXPECT_EQ(absoluteBundlePath(""), "");
}

}  // namespace
}  // namespace bundle
