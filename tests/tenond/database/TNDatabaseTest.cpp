// The plug-in database over a real registrar: one object per UUID until a
// purge or an uninstall, the all-or-nothing purge, lookups by path and
// application, registration, annotations with auto-election, install
// events and locale changes.

#include <gtest/gtest.h>

#include <cmath>

#include <fstream>

#include "platform/dispatch/Semaphore.h"
#include "platform/log/CaptureSink.h"
#include "platform/notify/Post.h"
#include "platform/value/Document.h"
#include "tests/tenond/database/DatabaseTestSupport.h"

namespace tnd::test {
namespace {

using tn::Dictionary;
using tn::Value;

bool logged(const tn::log::ScopedCaptureSink& capture, const std::string& text) {
  for (const auto& record : capture->records())
    if (record.text.find(text) != std::string::npos) return true;
  return false;
}

class Database : public ::testing::Test {
 protected:
  tn::UUID uuidAt(const std::string& bundle) {
    auto record = database_->workspace()->plugInForURL(tn::URL::fileURLWithPath(bundle));
    EXPECT_TRUE(record) << bundle;
    return record ? record->uuid() : tn::UUID();
  }
  void open() {
    database_ = TestDatabase::open(root_.annotationsPath());
    ASSERT_TRUE(database_);
    database_->setCacheLimit(1000000);
  }

  DatabaseRoot root_;
  std::shared_ptr<TestDatabase> database_;
};

TEST_F(Database, OneObjectPerUUIDUntilAPurgeEmptiesTheWholeCache) {
  std::vector<std::string> bundles;
  for (int i = 0; i < 4; ++i) bundles.push_back(root_.makeAppWithPlugIn("App" + std::to_string(i), "com.example.p" + std::to_string(i)));
  open();
  const auto first = database_->findPlugIn(uuidAt(bundles[0]));
  ASSERT_TRUE(first);
  EXPECT_EQ(database_->findPlugIn(uuidAt(bundles[0])), first);
  EXPECT_EQ(database_->plugInForProxy(database_->workspace()->plugInForURL(tn::URL::fileURLWithPath(bundles[0]))),
            first);

  // Limit 2: the fourth distinct plug-in finds three cached and empties the cache.
  database_->setCacheLimit(2);
  database_->findPlugIn(uuidAt(bundles[1]));
  database_->findPlugIn(uuidAt(bundles[2]));
  EXPECT_EQ(database_->cacheCount(), 3u);
  tn::log::ScopedCaptureSink capture;
  database_->findPlugIn(uuidAt(bundles[3]));
  EXPECT_EQ(database_->cacheCount(), 1u);
  EXPECT_TRUE(logged(capture, "purging cache for 3 > 2"));
  EXPECT_NE(database_->findPlugIn(uuidAt(bundles[0])), first) << "rebuilt after the purge";

  database_->setCacheLimit(0);
  database_->findPlugIn(uuidAt(bundles[1]));
  EXPECT_EQ(database_->cacheCount(), 1u);
}

TEST_F(Database, UnknownPathsUUIDsAndEmptyApplicationsGiveNone) {
  root_.makeApp(root_.appRoot(), "Empty", "com.example.empty");
  const std::string bundle = root_.makeAppWithPlugIn("Full", "com.example.full");
  open();
  tn::log::ScopedCaptureSink capture;
  EXPECT_FALSE(database_->findPlugInAtPath(tn::URL::fileURLWithPath("/nowhere/X.bundle")));
  EXPECT_TRUE(logged(capture, "Registrar cannot find plug-in at path:/nowhere/X.bundle"));
  const tn::UUID unknown = tn::UUID::random();
  EXPECT_FALSE(database_->findPlugIn(unknown));
  EXPECT_TRUE(logged(capture, "Registrar cannot find plug-in with UUID:" + unknown.string()));
  EXPECT_EQ(database_->cacheCount(), 0u);

  EXPECT_FALSE(database_->plugInsWithinApplication(tn::URL::fileURLWithPath(root_.appRoot() + "/Empty")));
  auto plugIns = database_->plugInsWithinApplication(tn::URL::fileURLWithPath(root_.appRoot() + "/Full"));
  ASSERT_TRUE(plugIns);
  ASSERT_EQ(plugIns->size(), 1u);
  EXPECT_EQ(database_->findPlugInAtPath(tn::URL::fileURLWithPath(bundle)), plugIns->front());
}

TEST_F(Database, RegistrationGoesToTheRegistrarWithTheDatabasesErrors) {
  const std::string loose = root_.path() + "/System/Library/PlugIns/Loose.bundle";
  registrar::test::PlatformRoot::writePlugIn(loose, "com.example.loose", "1");
  open();
  EXPECT_FALSE(database_->addPlugIn(tn::URL::fileURLWithPath(loose)));
  auto plugIn = database_->findPlugInAtPath(tn::URL::fileURLWithPath(loose));
  ASSERT_TRUE(plugIn) << "a loose plug-in on the system volume is usable";

  const auto refused = database_->addPlugIn(tn::URL::fileURLWithPath(root_.path() + "/missing.bundle"));
  ASSERT_TRUE(refused);
  EXPECT_EQ(refused->code(), 2);
  EXPECT_EQ(refused->message(), "Registrar failed to register the plug-in");

  EXPECT_FALSE(database_->removePlugIn(tn::URL::fileURLWithPath(loose)));
  EXPECT_FALSE(database_->workspace()->plugInForURL(tn::URL::fileURLWithPath(loose)));
  const auto notThere = database_->removePlugIn(tn::URL::fileURLWithPath(loose));
  ASSERT_TRUE(notThere);
  EXPECT_EQ(notThere->message(), "Registrar failed to deregister the plug-in");
}

TEST_F(Database, AutoElectionStoresElectionOneOnceAndRespectsNonZeroChoices) {
  const std::string extra =
      R"(, "XTExtensionAttributes": {"Kind": "thumb"})";
  const std::string bundle = root_.makeAppWithPlugIn("Auto", "com.example.auto", extra);
  tn::test::writeFile(bundle + "/Entitlements.manifest", R"({"com.ostrel.developer.auto-elect-plugin": true})");
  open();
  const tn::UUID uuid = uuidAt(bundle);
  auto plugIn = database_->findPlugIn(uuid);
  ASSERT_TRUE(plugIn);
  EXPECT_EQ(Value(*database_->annotationForPlugIn(*plugIn)), Value(Dictionary{{"election", Value(1)}}));

  // A user's 2 (and an extension dictionary) stand through later builds.
  database_->setAnnotation(Dictionary{{"election", Value(2)}, {"extension", Value(Dictionary{{"k", Value("v")}})}},
                           *plugIn);
  database_->setCacheLimit(0);
  database_->findPlugIn(tn::UUID::random());  // miss
  root_.makeAppWithPlugIn("Other", "com.example.other");
  ASSERT_TRUE(database_->workspace()->scan().ok());
  database_->findPlugIn(uuidAt(root_.appRoot() + "/Other/Support/PlugIns/com.example.other.bundle"));  // purges
  plugIn = database_->findPlugIn(uuid);
  EXPECT_EQ(Value(*database_->annotationForPlugIn(*plugIn))["election"], Value(2));

  // A stored 0 is replaced by 1; the extension dictionary stays.
  database_->setAnnotation(Dictionary{{"election", Value(0)}}, *plugIn);
  database_->findPlugIn(uuidAt(root_.appRoot() + "/Other/Support/PlugIns/com.example.other.bundle"));  // purges
  plugIn = database_->findPlugIn(uuid);
  const Value annotation(*database_->annotationForPlugIn(*plugIn));
  EXPECT_EQ(annotation["election"], Value(1));
  EXPECT_EQ(annotation["extension"], Value(Dictionary{{"k", Value("v")}}));
  // And the file says so.
  const Value file = *tn::readDocumentFile(root_.annotationsPath());
  EXPECT_EQ(file["data"]["com.example.auto"]["election"], Value(1));
}

// Elections stored as floating numbers are compared by value: never
// converted to an integer (undefined for huge numbers and NaN).
TEST_F(Database, AutoElectionComparesStoredElectionsByValue) {
  const std::string bundle = root_.makeAppWithPlugIn("Auto", "com.example.auto");
  tn::test::writeFile(bundle + "/Entitlements.manifest", R"({"com.ostrel.developer.auto-elect-plugin": true})");
  const std::string other = root_.makeAppWithPlugIn("Other", "com.example.other");
  open();
  const tn::UUID uuid = uuidAt(bundle);
  auto plugIn = database_->findPlugIn(uuid);
  ASSERT_TRUE(plugIn);
  database_->setCacheLimit(0);
  const std::vector<std::pair<Value, Value>> cases = {
      {Value(1e300), Value(1e300)},       {Value(-1e300), Value(-1e300)}, {Value(0.5), Value(0.5)},
      {Value(std::nan("")), Value(std::nan(""))}, {Value(-0.0), Value(1)}, {Value(false), Value(1)},
      {Value("2"), Value(1)},            {Value(18446744073709551615ULL), Value(18446744073709551615ULL)},
  };
  for (const auto& [stored, expected] : cases) {
    database_->setAnnotation(Dictionary{{"election", stored}}, *plugIn);
    database_->findPlugIn(uuidAt(other));  // purges, so the next find builds the record again
    plugIn = database_->findPlugIn(uuid);
    ASSERT_TRUE(plugIn);
    EXPECT_TRUE(Value::identical(Value(*database_->annotationForPlugIn(*plugIn))["election"], expected))
        << stored.description();
  }
}

TEST_F(Database, ReplacementPlugInsShareTheAnnotationOfThePlugInTheyReplace) {
  const std::string original = root_.makeAppWithPlugIn("Old", "com.example.viewer");
  const std::string replacement = root_.makeAppWithPlugIn("New", "com.example.viewer2");
  tn::test::writeFile(replacement + "/Entitlements.manifest",
                      R"({"com.ostrel.developer.replace-plugin": "com.example.viewer"})");
  open();
  auto old = database_->findPlugIn(uuidAt(original));
  auto successor = database_->findPlugIn(uuidAt(replacement));
  ASSERT_TRUE(old && successor);
  database_->setAnnotation(Dictionary{{"election", Value(1)}}, *old);
  EXPECT_EQ(Value(*database_->annotationForPlugIn(*successor))["election"], Value(1));
}

TEST_F(Database, AnUninstallLeavesTheCacheThenTellsTheDelegateWithTheRecords) {
  const std::string bundle = root_.makeAppWithPlugIn("Gone", "com.example.gone");
  open();
  auto delegate = std::make_shared<RecordingDelegate>();
  database_->setDelegate(delegate);
  const tn::UUID uuid = uuidAt(bundle);
  ASSERT_TRUE(database_->findPlugIn(uuid));

  tn::log::ScopedCaptureSink capture;
  std::filesystem::remove_all(root_.appRoot() + "/Gone");
  ASSERT_TRUE(database_->workspace()->scan().ok());
  database_->workspace()->waitForObservers();
  EXPECT_TRUE(logged(capture, "plug-in UNINSTALLED:com.example.gone com.example.gone(1) " + uuid.string()));
  EXPECT_EQ(database_->cacheCount(), 0u);
  {
    const std::lock_guard lock(delegate->mutex);
    ASSERT_EQ(delegate->batches.size(), 1u);
    ASSERT_EQ(delegate->batches[0].size(), 1u);
    EXPECT_EQ(delegate->batches[0][0]->uuid(), uuid);
  }
  EXPECT_FALSE(database_->findPlugIn(uuid)) << "the registrar no longer knows it";

  // An install is logged and cached only when asked for.
  root_.makeAppWithPlugIn("Fresh", "com.example.fresh");
  ASSERT_TRUE(database_->workspace()->scan().ok());
  database_->workspace()->waitForObservers();
  EXPECT_TRUE(logged(capture, "plug-in INSTALLED:com.example.fresh com.example.fresh(1)"));
  EXPECT_EQ(database_->cacheCount(), 0u);
}

TEST_F(Database, ALocaleChangePurgesTheCacheAndRenamesPlugIns) {
  const std::string bundle = root_.makeAppWithPlugIn("Named", "com.example.named");
  tn::test::makeDirectory(bundle + "/Localized");
  tn::test::makeDirectory(bundle + "/Localized/de");
  tn::test::writeFile(bundle + "/Localized/de/InfoManifest.manifest", R"({"BNBundleDisplayName": "Benannt"})");
  auto localeQueue = tn::dispatch::SerialQueue::create("locale-test");
  database_ = TestDatabase::open(root_.annotationsPath(), localeQueue);
  ASSERT_TRUE(database_);
  database_->setCacheLimit(100);
  ASSERT_TRUE(database_->findPlugIn(uuidAt(bundle)));

  tn::log::ScopedCaptureSink capture;
  tn::test::makeDirectory(root_.path() + "/etc");
  tn::test::writeFile(root_.path() + "/etc/locale.conf.new", "LANG=de_DE.UTF-8\n");
  std::filesystem::rename(root_.path() + "/etc/locale.conf.new", root_.path() + "/etc/locale.conf");
  for (int i = 0; i < 500 && !logged(capture, "locale change detected; purging cache"); ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  localeQueue->sync([] {});
  EXPECT_TRUE(logged(capture, "locale change detected; purging cache"));
  EXPECT_EQ(database_->cacheCount(), 0u);
  EXPECT_EQ(database_->findPlugIn(uuidAt(bundle))->localizedName(), "Benannt");
}

TEST_F(Database, AnnotationChangesArePostedOnlyWhenAsked) {
  const std::string bundle = root_.makeAppWithPlugIn("Posted", "com.example.posted");
  open();
  auto plugIn = database_->findPlugIn(uuidAt(bundle));
  const uint64_t before = notify::postCount(TNDatabase::kAnnotationChangeNotification).ok()
                              ? *notify::postCount(TNDatabase::kAnnotationChangeNotification)
                              : 0;
  database_->setAnnotation(Dictionary{{"election", Value(1)}}, *plugIn);
  EXPECT_EQ(*notify::postCount(TNDatabase::kAnnotationChangeNotification), before) << "setAnnotation posts nothing";
  database_->notifyAnnotationChange();
  EXPECT_EQ(*notify::postCount(TNDatabase::kAnnotationChangeNotification), before + 1);
}

}  // namespace
}  // namespace tnd::test
