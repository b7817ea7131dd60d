// Starting from the store and following changes one application at a time:
// the background verification of a warm start, incremental rescans after
// the watcher saw a change, and copies in progress.

#include <gtest/gtest.h>

#include <fcntl.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>

#include "platform/log/Log.h"
#include "tests/platform/registrar/RegistrarTestSupport.h"

namespace registrar::test {
namespace {

using namespace std::chrono_literals;

// Waits until the observer has seen at least count batches.
void waitForBatches(RecordingObserver& observer, size_t count) {
  while (observer.batches().size() < count) ASSERT_TRUE(observer.delivered.waitFor(10s)) << "no batch came";
}

std::string plugInManifest(const std::string& identifier) {
  return fmt::format(R"({{"BNBundleIdentifier": "{0}", "BNBundleName": "{0}",
    "XTExtension": {{"XTExtensionPointIdentifier": "com.example.thumbnails",
      "XTExtensionProtocol": "com.example.protocol"}}}})",
                     identifier);
}

TEST(RegistrarWarmStart, ChangesMadeWhileClosedAreInstallsAndUninstallsAfterVerification) {
  PlatformRoot root;
  const std::string kept = root.makeApp(root.appRoot(), "Kept", "com.example.kept");
  PlatformRoot::makePlugIn(kept, "K", "com.example.k");
  const std::string changed = root.makeApp(root.appRoot(), "Changed", "com.example.changed");
  const std::string changedPlugIn = PlatformRoot::makePlugIn(changed, "C", "com.example.c", "1");
  const std::string removed = root.makeApp(root.appRoot(), "Removed", "com.example.removed");
  PlatformRoot::makePlugIn(removed, "R", "com.example.r");
  tn::UUID keptUUID;
  {
    auto first = root.open(quiet());
    ASSERT_TRUE(first);
    keptUUID = first->plugInForURL(tn::URL::fileURLWithPath(kept + "/Support/PlugIns/K"))->uuid();
  }

  // While no registrar runs: one bundle updated, one application removed, one added.
  PlatformRoot::writePlugIn(changedPlugIn, "com.example.c", "2");
  std::filesystem::remove_all(removed);
  const std::string added = root.makeApp(root.appRoot(), "Added", "com.example.added");
  PlatformRoot::makePlugIn(added, "A", "com.example.a");

  auto observer = std::make_shared<RecordingObserver>();
  Registrar::Options options = quiet();
  options.initialScan = Registrar::InitialScan::Auto;
  options.observers.push_back(observer);
  auto registrar = root.open(options);
  ASSERT_TRUE(registrar);
  // The store answers at once, whether or not the verification has run yet.
  EXPECT_EQ(registrar->plugInForUUID(keptUUID)->identifier(), "com.example.k");

  registrar->waitForObservers();
  EXPECT_EQ(observer->batches(),
            (Batches{{"-com.example.c", "-com.example.r"}, {"+com.example.a", "+com.example.c"}}));
  EXPECT_EQ(registrar->plugInForURL(tn::URL::fileURLWithPath(changedPlugIn))->bundleVersion(), "2");
  EXPECT_EQ(registrar->plugInForUUID(keptUUID)->identifier(), "com.example.k") << "unchanged keeps its UUID";
  const ScanSummary verified = registrar->lastScan();
  EXPECT_FALSE(verified.incremental);
  EXPECT_EQ(verified.installed, 2u);
  EXPECT_EQ(verified.uninstalled, 2u);
  EXPECT_EQ(verified.read, 3u) << "the changed plug-in, the added application and its plug-in, nothing unchanged";
}

TEST(RegistrarWarmStart, AFirstStartWaitsForTheScanAndLogsItsProgress) {
  PlatformRoot root;
  const std::string app = root.makeApp(root.appRoot(), "App", "com.example.app");
  PlatformRoot::makePlugIn(app, "P", "com.example.p");
  auto observer = std::make_shared<RecordingObserver>();
  Registrar::Options options = quiet();
  options.initialScan = Registrar::InitialScan::Auto;
  options.observers.push_back(observer);

  tn::log::ScopedCaptureSink capture;
  auto registrar = root.open(options);
  ASSERT_TRUE(registrar);
  EXPECT_EQ(registrar->installedPlugIns().size(), 1u) << "an empty store is filled before open returns";
  EXPECT_TRUE(capture->contains("rg", tn::log::Level::Default, "scanning the application roots"));
  EXPECT_TRUE(capture->contains("rg", tn::log::Level::Default, "1 applications, 1 plug-ins, 0 skipped"));
  registrar->waitForObservers();
  EXPECT_TRUE(observer->batches().empty()) << "the first contents are no install events";
}

TEST(RegistrarIncremental, AChangeRescansOnlyItsApplication) {
  PlatformRoot root;
  for (const char* name : {"One", "Two", "Three"}) {
    const std::string app = root.makeApp(root.appRoot(), name, std::string("com.example.") + name);
    PlatformRoot::makePlugIn(app, "P", std::string("com.example.p.") + name);
  }
  Registrar::Options options;
  options.settle = 0ms;
  auto registrar = root.open(options);
  auto observer = std::make_shared<RecordingObserver>(registrar);
  registrar->addObserver(observer);

  // Renamed into the root, as installers do: complete at once.
  const std::string staging = root.path() + "/staging/Four";
  tn::test::makeBundle(staging, R"({"BNBundleIdentifier": "com.example.four"})");
  PlatformRoot::makePlugIn(staging, "P", "com.example.p.four");
  std::filesystem::rename(staging, root.appRoot() + "/Four");
  waitForBatches(*observer, 1);
  registrar->waitForObservers();
  ScanSummary last = registrar->lastScan();
  EXPECT_TRUE(last.incremental);
  EXPECT_EQ(last.examined, 1u);
  EXPECT_EQ(last.read, 2u);
  EXPECT_EQ(last.plugIns, 4u);

  // A manifest rewritten in place inside one application.
  PlatformRoot::writePlugIn(root.appRoot() + "/Two/Support/PlugIns/P", "com.example.p.Two", "2");
  waitForBatches(*observer, 3);
  registrar->waitForObservers();
  last = registrar->lastScan();
  EXPECT_TRUE(last.incremental);
  EXPECT_EQ(last.examined, 1u);
  EXPECT_LE(last.read, 1u) << "the write and the mode change after it may make two rescans";

  // An application moved out of the root.
  std::filesystem::rename(root.appRoot() + "/One", root.path() + "/staging/One");
  waitForBatches(*observer, 4);
  registrar->waitForObservers();
  last = registrar->lastScan();
  EXPECT_TRUE(last.incremental);
  // The mode change that ended the rewrite of Two may share this rescan
  // (and read its manifest once more: its change time moved).
  EXPECT_LE(last.examined, 1u);
  EXPECT_LE(last.read, 1u);
  EXPECT_EQ(last.uninstalled, 1u);
  EXPECT_EQ(observer->batches(), (Batches{{"+com.example.p.four"},
                                          {"-com.example.p.Two"},
                                          {"+com.example.p.Two"},
                                          {"-com.example.p.One"}}));
  EXPECT_EQ(registrar->installedPlugIns().size(), 3u);
  // A full scan finds nothing the incremental ones missed.
  const tn::Result<ScanSummary> full = registrar->scan();
  ASSERT_TRUE(full.ok());
  EXPECT_FALSE(full->changed);
  EXPECT_EQ(full->read, 0u);
}

TEST(RegistrarIncremental, ARegisteredBundleChangedOrRemovedIsRescannedAlone) {
  PlatformRoot root;
  const std::string app = root.makeApp(root.appRoot(), "App", "com.example.app");
  PlatformRoot::makePlugIn(app, "P", "com.example.p");
  const std::string loose = root.path() + "/loose/Loose.tnx";
  PlatformRoot::writePlugIn(loose, "com.example.loose", "1");
  tn::test::writeFile(root.path() + "/loose/unrelated.txt", "x");
  Registrar::Options options;
  options.settle = 0ms;
  auto registrar = root.open(options);
  ASSERT_TRUE(registrar->registerPlugIn(tn::URL::fileURLWithPath(loose)).ok());
  auto observer = std::make_shared<RecordingObserver>(registrar);
  registrar->addObserver(observer);

  PlatformRoot::writePlugIn(loose, "com.example.loose", "2");
  waitForBatches(*observer, 2);
  registrar->waitForObservers();
  EXPECT_TRUE(registrar->lastScan().incremental);
  EXPECT_EQ(registrar->lastScan().examined, 1u);
  EXPECT_EQ(registrar->plugInForURL(tn::URL::fileURLWithPath(loose))->bundleVersion(), "2");

  std::filesystem::rename(loose, root.path() + "/loose/Moved.tnx");
  waitForBatches(*observer, 3);
  registrar->waitForObservers();
  EXPECT_TRUE(registrar->lastScan().incremental);
  EXPECT_EQ(observer->batches(), (Batches{{"-com.example.loose"}, {"+com.example.loose"}, {"-com.example.loose"}}));
  EXPECT_EQ(registrar->installedPlugIns().size(), 1u);
}

TEST(RegistrarIncremental, ABundleCopiedFileByFileIsReadOnceComplete) {
  PlatformRoot root;
  const std::string app = root.makeApp(root.appRoot(), "App", "com.example.app");
  PlatformRoot::makePlugIn(app, "Old", "com.example.old");
  // The copy's directory exists (and is watched) before its files are written.
  const std::string copied = app + "/Support/PlugIns/Copied";
  tn::test::makeDirectory(copied);
  Registrar::Options options;
  options.settle = 0ms;  // only the open file holds the copy back
  auto registrar = root.open(options);
  auto observer = std::make_shared<RecordingObserver>(registrar);
  registrar->addObserver(observer);
  tn::log::ScopedCaptureSink capture;

  const std::string manifest = plugInManifest("com.example.copied");
  const int fd = ::open((copied + "/Info.manifest").c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644);
  ASSERT_GE(fd, 0);
  const size_t half = manifest.size() / 2;
  ASSERT_EQ(::write(fd, manifest.data(), half), static_cast<ssize_t>(half));

  // Meanwhile another application is renamed into the root: it is installed
  // at once, while the half-written manifest waits for its close.
  const std::string staging = root.path() + "/staging/Other";
  tn::test::makeBundle(staging, R"({"BNBundleIdentifier": "com.example.other"})");
  PlatformRoot::makePlugIn(staging, "P", "com.example.other.p");
  std::filesystem::rename(staging, root.appRoot() + "/Other");
  waitForBatches(*observer, 1);
  registrar->waitForObservers();
  EXPECT_EQ(observer->batches(), (Batches{{"+com.example.other.p"}}));
  EXPECT_FALSE(registrar->plugInForURL(tn::URL::fileURLWithPath(copied)));

  ASSERT_EQ(::write(fd, manifest.data() + half, manifest.size() - half),
            static_cast<ssize_t>(manifest.size() - half));
  ASSERT_EQ(::close(fd), 0);
  waitForBatches(*observer, 2);
  registrar->waitForObservers();
  EXPECT_EQ(observer->batches().back(), (std::vector<std::string>{"+com.example.copied"}));
  EXPECT_EQ(capture->count("rg", tn::log::Level::Error, copied), 0u) << "never read half written";
}

TEST(RegistrarMemory, RecordsLoadedFromTheStoreShareEqualDictionaries) {
  PlatformRoot root;
  const std::string app = root.makeApp(root.appRoot(), "App", "com.example.app");
  const std::string one = PlatformRoot::makePlugIn(app, "One", "com.example.one");
  const std::string two = PlatformRoot::makePlugIn(app, "Two", "com.example.two");
  { root.open(quiet()); }
  auto registrar = root.open(quiet());
  const PlugInPtr first = registrar->plugInForURL(tn::URL::fileURLWithPath(one));
  const PlugInPtr second = registrar->plugInForURL(tn::URL::fileURLWithPath(two));
  ASSERT_TRUE(first && second);
  EXPECT_EQ(first->plugInDictionary().dictionary(), second->plugInDictionary().dictionary())
      << "the same \"XTExtension\" is held once";
  EXPECT_EQ(first->entitlements().dictionary(), second->entitlements().dictionary());
  EXPECT_NE(first->infoDictionary().dictionary(), second->infoDictionary().dictionary());
  EXPECT_EQ(*first->infoDictionary()["BNBundleIdentifier"].string(), "com.example.one");
}

}  // namespace
}  // namespace registrar::test
