// Installs, updates and uninstalls: observers, knowledge, registration by
// URL, and the inotify watch.

#include <gtest/gtest.h>

#include <chrono>
#include <filesystem>
#include <mutex>

#include "tests/platform/registrar/RegistrarTestSupport.h"

namespace registrar::test {
namespace {

using namespace std::chrono_literals;


TEST(RegistrarChanges, UpdateIsAnUninstallThenAnInstallWithANewUUID) {
  PlatformRoot root;
  const std::string app = root.makeApp(root.appRoot(), "App", "com.example.app");
  const std::string plugIn = PlatformRoot::makePlugIn(app, "P", "com.example.p", "1");
  PlatformRoot::makePlugIn(app, "Q", "com.example.q", "1");
  auto registrar = root.open(quiet());
  auto observer = std::make_shared<RecordingObserver>(registrar);
  registrar->addObserver(observer);
  const PlugInPtr before = registrar->plugInForURL(tn::URL::fileURLWithPath(plugIn));
  const tn::UUID knowledge = registrar->knowledgeUUID();

  PlatformRoot::writePlugIn(plugIn, "com.example.p", "2");
  const tn::Result<ScanSummary> scanned = registrar->scan();
  ASSERT_TRUE(scanned.ok());
  EXPECT_EQ(scanned->installed, 1u);
  EXPECT_EQ(scanned->uninstalled, 1u);
  const PlugInPtr after = registrar->plugInForURL(tn::URL::fileURLWithPath(plugIn));
  EXPECT_NE(after->uuid(), before->uuid());
  EXPECT_EQ(after->bundleVersion(), "2");
  EXPECT_NE(registrar->knowledgeUUID(), knowledge);
  EXPECT_EQ(before->bundleVersion(), "1");  // records are values

  registrar->waitForObservers();
  EXPECT_EQ(observer->batches(), (Batches{{"-com.example.p"}, {"+com.example.p"}}));
  EXPECT_TRUE(observer->uninstalledStayedVisible());
  EXPECT_FALSE(registrar->plugInForUUID(before->uuid()));

  // Removing the application uninstalls its plug-ins in one batch.
  std::filesystem::remove_all(app);
  ASSERT_TRUE(registrar->scan().ok());
  registrar->waitForObservers();
  EXPECT_EQ(observer->batches().back(), (std::vector<std::string>{"-com.example.p", "-com.example.q"}));
  EXPECT_TRUE(registrar->installedPlugIns().empty());
  EXPECT_TRUE(registrar->applications().empty());
}

TEST(RegistrarChanges, KnowledgeChangesExactlyWhenContentsDo) {
  PlatformRoot root;
  auto registrar = root.open(quiet());
  EXPECT_TRUE(registrar->knowledgeUUID().isNil());  // nothing ever registered
  const std::string app = root.makeApp(root.appRoot(), "App", "com.example.app");
  ASSERT_TRUE(registrar->scan().ok());
  const tn::UUID withApp = registrar->knowledgeUUID();
  EXPECT_FALSE(withApp.isNil());
  ASSERT_TRUE(registrar->scan().ok());
  EXPECT_EQ(registrar->knowledgeUUID(), withApp);
  tn::test::writeFile(root.paths().extensionPointsDirectory + "/com.example.share.manifest", "{}");
  ASSERT_TRUE(registrar->scan().ok());
  EXPECT_NE(registrar->knowledgeUUID(), withApp);
}

TEST(RegistrarChanges, PlugInsOutsideApplicationsAreRegisteredByURL) {
  PlatformRoot root;
  const std::string loose = root.path() + "/System/Library/PlugIns/Loose.tnx";
  PlatformRoot::writePlugIn(loose, "com.example.loose", "1");
  auto registrar = root.open(quiet());
  auto observer = std::make_shared<RecordingObserver>(registrar);
  registrar->addObserver(observer);
  EXPECT_TRUE(registrar->installedPlugIns().empty());

  ASSERT_TRUE(registrar->registerPlugIn(tn::URL::fileURLWithPath(loose + "/")).ok());
  const PlugInPtr record = registrar->plugInForURL(tn::URL::fileURLWithPath(loose));
  ASSERT_TRUE(record);
  EXPECT_FALSE(record->containingApp());
  EXPECT_TRUE(record->onSystemPartition());
  EXPECT_TRUE(record->registeredByURL());
  const tn::UUID knowledge = registrar->knowledgeUUID();
  ASSERT_TRUE(registrar->registerPlugIn(tn::URL::fileURLWithPath(loose)).ok());  // again: no change
  EXPECT_EQ(registrar->knowledgeUUID(), knowledge);
  ASSERT_TRUE(registrar->scan().ok());  // a rescan keeps it
  EXPECT_EQ(registrar->plugInForURL(tn::URL::fileURLWithPath(loose))->uuid(), record->uuid());
  {
    auto reopened = root.open(quiet());
    EXPECT_EQ(reopened->plugInForUUID(record->uuid())->bundlePath(), loose);
  }

  const tn::Result<void> missing = registrar->registerPlugIn(tn::URL::fileURLWithPath(root.path() + "/nothing"));
  ASSERT_FALSE(missing.ok());
  EXPECT_EQ(missing.error().code(), static_cast<int64_t>(RegistrarErrorCode::NotFound));
  tn::test::makeBundle(root.path() + "/Bad", R"({"BNBundleIdentifier": "com.example.bad"})");
  const tn::Result<void> bad = registrar->registerPlugIn(tn::URL::fileURLWithPath(root.path() + "/Bad"));
  ASSERT_FALSE(bad.ok());
  EXPECT_NE(bad.error().message()->find(root.path() + "/Bad: Info.manifest has no \"XTExtension\""),
            std::string::npos);

  // A path with a NUL names nothing, even when the part before it is a plug-in.
  const tn::URL withNul = tn::URL::fileURLWithPath(loose + std::string("\0/x", 3));
  EXPECT_FALSE(registrar->plugInForURL(withNul));
  EXPECT_EQ(registrar->registerPlugIn(withNul).error().code(), static_cast<int64_t>(RegistrarErrorCode::NotFound));
  EXPECT_EQ(registrar->unregisterPlugIn(withNul).error().code(), static_cast<int64_t>(RegistrarErrorCode::NotFound));
  EXPECT_TRUE(registrar->plugInForURL(tn::URL::fileURLWithPath(loose))) << "still registered";

  ASSERT_TRUE(registrar->unregisterPlugIn(tn::URL::fileURLWithPath(loose)).ok());
  EXPECT_FALSE(registrar->plugInForURL(tn::URL::fileURLWithPath(loose)));
  EXPECT_FALSE(registrar->unregisterPlugIn(tn::URL::fileURLWithPath(loose)).ok());
  registrar->waitForObservers();
  EXPECT_EQ(observer->batches(), (Batches{{"+com.example.loose"}, {"-com.example.loose"}}));

  // Plug-ins of applications belong to their application.
  const std::string app = root.makeApp(root.appRoot(), "App", "com.example.app");
  const std::string inApp = PlatformRoot::makePlugIn(app, "P", "com.example.p");
  ASSERT_TRUE(registrar->registerPlugIn(tn::URL::fileURLWithPath(inApp)).ok());
  const tn::Result<void> refused = registrar->unregisterPlugIn(tn::URL::fileURLWithPath(inApp));
  ASSERT_FALSE(refused.ok());
  EXPECT_EQ(refused.error().code(), static_cast<int64_t>(RegistrarErrorCode::NotRegistered));
}

TEST(RegistrarChanges, ApplicationsCopiedInWhileRunningAreInstalled) {
  PlatformRoot root;
  Registrar::Options options;
  options.settle = 50ms;
  auto registrar = root.open(options);
  auto observer = std::make_shared<RecordingObserver>(registrar);
  registrar->addObserver(observer);

  // Built elsewhere, then moved in as a whole, as installers do.
  const std::string staging = root.path() + "/staging/Viewer";
  tn::test::makeBundle(staging, R"({"BNBundleIdentifier": "com.example.viewer"})");
  PlatformRoot::makePlugIn(staging, "Thumbs.tnx", "com.example.thumbs");
  std::filesystem::rename(staging, root.appRoot() + "/Viewer");
  ASSERT_TRUE(observer->delivered.waitFor(10s));
  EXPECT_EQ(observer->batches(), (Batches{{"+com.example.thumbs"}}));

  // A plug-in replaced inside the installed application.
  const std::string plugIn = root.appRoot() + "/Viewer/Support/PlugIns/Thumbs.tnx";
  std::filesystem::remove_all(plugIn);
  PlatformRoot::writePlugIn(plugIn, "com.example.thumbs", "2");
  while (observer->batches().size() < 3) ASSERT_TRUE(observer->delivered.waitFor(10s));
  const Batches batches = observer->batches();
  ASSERT_GE(batches.size(), 3u);
  EXPECT_EQ(batches[1], (std::vector<std::string>{"-com.example.thumbs"}));
  EXPECT_EQ(batches.back(), (std::vector<std::string>{"+com.example.thumbs"}));
  EXPECT_EQ(registrar->plugInForURL(tn::URL::fileURLWithPath(plugIn))->bundleVersion(), "2");
}

}  // namespace
}  // namespace registrar::test
