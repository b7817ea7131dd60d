// Scanning roots into records, the queries, bad input and the store.

#include <gtest/gtest.h>

#include <sqlite3.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "platform/log/Log.h"
#include "platform/registrar/Store.h"
#include "tests/platform/registrar/RegistrarTestSupport.h"

namespace registrar::test {
namespace {

using tn::test::writeFile;

TEST(RegistrarScan, RecordsApplicationsPlugInsAndExtensionPoints) {
  PlatformRoot root;
  const std::string app = root.makeApp(root.appRoot(), "Viewer", "com.example.viewer");
  const std::string thumbs = PlatformRoot::makePlugIn(app, "Thumbs.tnx", "com.example.viewer.thumbs", "2.1");
  const std::string data = PlatformRoot::makePlugIn(app, "Data", "com.example.viewer.data", "1", "", "#Data");
  const std::string nested = PlatformRoot::makePlugIn(thumbs, "Inner", "com.example.viewer.inner");
  const std::string systemApp = root.makeApp(root.systemRoot(), "Finder", "com.example.finder");
  PlatformRoot::makePlugIn(systemApp, "Share", "com.example.finder.share");
  writeFile(root.paths().extensionPointsDirectory + "/com.example.thumbnails.manifest",
            R"({"XTExtension": {"CleanTimeout": 5}})");

  auto registrar = root.open(quiet());
  ASSERT_TRUE(registrar);
  EXPECT_FALSE(registrar->knowledgeUUID().isNil());
  ASSERT_EQ(registrar->installedPlugIns().size(), 4u);

  const PlugInPtr plugIn = registrar->plugInForURL(tn::URL::fileURLWithPath(thumbs + "/"));
  ASSERT_TRUE(plugIn);
  EXPECT_EQ(plugIn->identifier(), "com.example.viewer.thumbs");
  EXPECT_EQ(plugIn->bundleIdentifier(), "com.example.viewer.thumbs");
  EXPECT_EQ(plugIn->bundleVersion(), "2.1");
  EXPECT_TRUE(plugIn->isAppExtension());
  EXPECT_EQ(plugIn->extensionPointIdentifier(), "com.example.thumbnails");
  EXPECT_EQ(plugIn->plugInDictionary()["XTExtensionAttributes"]["Kind"], tn::Value("thumb"));
  EXPECT_EQ(plugIn->infoDictionary()["BNBundleVersion"], tn::Value("2.1"));
  EXPECT_FALSE(plugIn->onSystemPartition());
  ASSERT_TRUE(plugIn->containingApp());
  EXPECT_EQ(plugIn->containingApp()->bundlePath(), app);
  EXPECT_EQ(plugIn->containingApp()->identifier(), "com.example.viewer");
  EXPECT_EQ(registrar->plugInForUUID(plugIn->uuid()), plugIn);

  // A data container for every plug-in but data plug-ins.
  ASSERT_TRUE(plugIn->dataContainerPath());
  EXPECT_EQ(*plugIn->dataContainerPath(), root.paths().containersDirectory + "/com.example.viewer.thumbs");
  EXPECT_TRUE(std::filesystem::is_directory(*plugIn->dataContainerPath() + "/tmp"));
  const PlugInPtr dataPlugIn = registrar->plugInForURL(tn::URL::fileURLWithPath(data));
  ASSERT_TRUE(dataPlugIn);
  EXPECT_TRUE(dataPlugIn->isData());
  EXPECT_FALSE(dataPlugIn->dataContainerPath());

  // A plug-in nested in a plug-in belongs to the same application.
  const PlugInPtr inner = registrar->plugInForURL(tn::URL::fileURLWithPath(nested));
  ASSERT_TRUE(inner);
  EXPECT_EQ(inner->containingApp()->bundlePath(), app);

  const AppPtr viewer = registrar->applicationForURL(tn::URL::fileURLWithPath(app));
  ASSERT_TRUE(viewer);
  EXPECT_FALSE(viewer->isPlaceholder());
  const PlugInList ofViewer = registrar->plugInsOfApplication(*viewer);
  ASSERT_EQ(ofViewer.size(), 3u);
  EXPECT_EQ(ofViewer[0]->bundlePath(), data);  // ordered by path
  EXPECT_EQ(ofViewer[1]->bundlePath(), thumbs);
  EXPECT_EQ(ofViewer[2]->bundlePath(), nested);

  const AppPtr finder = registrar->applicationForURL(tn::URL::fileURLWithPath(systemApp));
  ASSERT_TRUE(finder);
  EXPECT_TRUE(finder->onSystemPartition());
  EXPECT_TRUE(registrar->plugInsOfApplication(*finder).at(0)->onSystemPartition());

  const ExtensionPointPtr point = registrar->extensionPoint("com.example.thumbnails");
  ASSERT_TRUE(point);
  EXPECT_EQ(point->sdkDictionary()["XTExtension"]["CleanTimeout"], tn::Value(5));
  EXPECT_FALSE(registrar->extensionPoint("com.example.other"));
  EXPECT_FALSE(registrar->plugInForUUID(tn::UUID::random()));
  EXPECT_FALSE(registrar->plugInForURL(tn::URL::fileURLWithPath(app + "/nothing")));
}

TEST(RegistrarScan, PlaceholderApplicationsAreMarked) {
  PlatformRoot root;
  const std::string app = root.makeApp(root.appRoot(), "Installing", "com.example.installing");
  PlatformRoot::makePlugIn(app, "P", "com.example.installing.p");
  writeFile(app + "/.installing", "");
  // A placeholder still being copied may lack its manifest.
  tn::test::makeDirectory(root.appRoot() + "/Empty");
  writeFile(root.appRoot() + "/Empty/.installing", "");

  auto registrar = root.open(quiet());
  const AppPtr record = registrar->applicationForURL(tn::URL::fileURLWithPath(app));
  ASSERT_TRUE(record);
  EXPECT_TRUE(record->isPlaceholder());
  EXPECT_EQ(registrar->plugInsOfApplication(*record).size(), 1u);
  const AppPtr empty = registrar->applicationForURL(tn::URL::fileURLWithPath(root.appRoot() + "/Empty"));
  ASSERT_TRUE(empty);
  EXPECT_TRUE(empty->isPlaceholder());

  std::filesystem::remove(app + "/.installing");
  const tn::UUID before = registrar->knowledgeUUID();
  ASSERT_TRUE(registrar->scan().ok());
  EXPECT_FALSE(registrar->applicationForURL(tn::URL::fileURLWithPath(app))->isPlaceholder());
  EXPECT_NE(registrar->knowledgeUUID(), before);
}

TEST(RegistrarScan, BadBundlesAreSkippedWithOneLineEach) {
  PlatformRoot root;
  const std::string app = root.makeApp(root.appRoot(), "Mixed", "com.example.mixed");
  PlatformRoot::makePlugIn(app, "Good", "com.example.good");
  const std::string plugIns = app + "/Support/PlugIns";
  tn::test::makeDirectory(plugIns + "/NoManifest");
  tn::test::makeBundle(plugIns + "/Malformed", "{\"XTExtension\": ");
  tn::test::makeBundle(plugIns + "/NoIdentifier", R"({"XTExtension": {"XTExtensionProtocol": "p"}})");
  tn::test::makeBundle(plugIns + "/NotAPlugIn", R"({"BNBundleIdentifier": "com.example.lib"})");
  ASSERT_EQ(::symlink("/nonexistent/target", (plugIns + "/Dangling").c_str()), 0);
  ASSERT_EQ(::mkfifo((plugIns + "/Fifo").c_str(), 0644), 0);
  tn::test::makeDirectory(plugIns + "/FifoManifest");
  ASSERT_EQ(::mkfifo((plugIns + "/FifoManifest/Info.manifest").c_str(), 0644), 0);
  // An identifier that would lead out of the containers directory.
  PlatformRoot::makePlugIn(app, "Escape", "..");

  tn::log::ScopedCaptureSink capture;
  auto registrar = root.open(quiet());
  ASSERT_TRUE(registrar);
  const PlugInList plugIns_ = registrar->installedPlugIns();
  ASSERT_EQ(plugIns_.size(), 2u);
  EXPECT_EQ(plugIns_[0]->identifier(), "..");
  EXPECT_FALSE(plugIns_[0]->dataContainerPath());
  EXPECT_EQ(plugIns_[1]->identifier(), "com.example.good");
  for (const char* name : {"NoManifest", "Malformed", "NoIdentifier", "NotAPlugIn", "FifoManifest"}) {
    EXPECT_EQ(capture->count("rg", tn::log::Level::Error, plugIns + "/" + std::string(name) + ":"), 1u) << name;
  }
  EXPECT_TRUE(capture->contains("rg", tn::log::Level::Error, plugIns + "/Dangling: dangling symbolic link"));
  EXPECT_TRUE(capture->contains("rg", tn::log::Level::Error, plugIns + "/Fifo: not a directory"));
  EXPECT_FALSE(std::filesystem::exists(root.paths().containersDirectory + "/.."  "/tmp"));
}

TEST(RegistrarEntitlements, ComeFromTrustedDocumentsOnly) {
  PlatformRoot root;
  const std::string app = root.makeApp(root.appRoot(), "App", "com.example.app");
  const std::string trusted = PlatformRoot::makePlugIn(app, "Trusted", "com.example.trusted",
                                                       "1", R"(, "XTExtensionIdentifier": "com.example.trusted")");
  writeFile(trusted + "/Info.manifest",
            R"({"BNBundleIdentifier": "com.example.trusted", "BNBundleExecutable": "run",
                "XTExtension": {"XTExtensionProtocol": "p"}})");
  writeFile(trusted + "/bin/run", "#!/bin/true\n", 0755);
  writeFile(trusted + "/Entitlements.manifest", R"({"com.ostrel.developer.auto-elect-plugin": true})");
  const std::string loose = PlatformRoot::makePlugIn(app, "Loose", "com.example.loose");
  writeFile(loose + "/Entitlements.manifest", R"({"com.ostrel.developer.auto-elect-plugin": true})", 0666);
  const std::string data = PlatformRoot::makePlugIn(app, "Data", "com.example.data", "1", "", "#Data");
  writeFile(data + "/Entitlements.manifest", R"({"com.ostrel.developer.replace-plugin": "com.example.old"})");

  tn::log::ScopedCaptureSink capture;
  auto registrar = root.open(quiet());
  const auto entitlementsOf = [&](const std::string& path) {
    return registrar->plugInForURL(tn::URL::fileURLWithPath(path))->entitlements();
  };
  EXPECT_EQ(entitlementsOf(trusted)["com.ostrel.developer.auto-elect-plugin"], tn::Value(true));
  EXPECT_TRUE(entitlementsOf(loose).dictionary()->empty());
  EXPECT_TRUE(capture->contains("rg", tn::log::Level::Error, loose + "/Entitlements.manifest"));
  EXPECT_EQ(entitlementsOf(data)["com.ostrel.developer.replace-plugin"], tn::Value("com.example.old"));
}

TEST(RegistrarLocale, NamesAndStringsFollowTheLocale) {
  PlatformRoot root;
  const std::string app = root.makeApp(root.appRoot(), "Viewer", "com.example.viewer");
  const std::string plugIn = PlatformRoot::makePlugIn(app, "Share.tnx", "com.example.share");
  writeFile(plugIn + "/Localized/de/InfoManifest.manifest",
            R"({"BNBundleDisplayName": "Teilen", "BNBundleName": "Teil"})");
  writeFile(plugIn + "/Localized/de_AT/InfoManifest.manifest", R"J({"BNBundleDisplayName": "Teilen (AT)"})J");
  writeFile(plugIn + "/Localized/de/Localizable.manifest", R"({"Open": "Öffnen", "Save": "Sichern"})");
  writeFile(plugIn + "/Localized/de_DE/Localizable.manifest", R"J({"Open": "Öffnen (DE)"})J");
  writeFile(plugIn + "/Localized/Base/Localizable.manifest", R"({"Open": "Open", "Quit": "Quit"})");
  writeFile(app + "/Localized/de/InfoManifest.manifest", R"({"BNBundleDisplayName": "Betrachter"})");

  Registrar::Options options = quiet();
  options.locale = "de_DE.UTF-8";
  auto registrar = root.open(options);
  const auto record = [&] { return registrar->plugInForURL(tn::URL::fileURLWithPath(plugIn)); };
  EXPECT_EQ(record()->localizedName(), "Teilen");  // de_DE has no names: falls back to de
  EXPECT_EQ(record()->localizedShortName(), "Teil");
  EXPECT_EQ(record()->containingApp()->localizedName(), "Betrachter");
  const std::set<std::string, std::less<>> keys = {"Open", "Save", "Quit", "Missing"};
  const std::optional<LocalizedStrings> strings = registrar->localizedStrings(plugIn, "Localizable", keys);
  ASSERT_TRUE(strings);
  EXPECT_EQ(*strings, (LocalizedStrings{{"Open", "Öffnen (DE)"}, {"Save", "Sichern"}, {"Quit", "Quit"}}));
  EXPECT_FALSE(registrar->localizedStrings(plugIn, "Other", keys));

  const tn::UUID uuid = record()->uuid();
  const tn::UUID knowledge = registrar->knowledgeUUID();
  registrar->setLocale("de_AT");
  EXPECT_EQ(record()->localizedName(), "Teilen (AT)");
  EXPECT_EQ(record()->localizedShortName(), "Teil");
  registrar->setLocale("fr_FR");
  EXPECT_EQ(record()->localizedName(), "com.example.share");  // the manifest's BNBundleName
  EXPECT_EQ(record()->containingApp()->localizedName(), "Viewer");
  EXPECT_EQ(registrar->localizedStrings(plugIn, "Localizable", keys)->at("Open"), "Open");
  EXPECT_EQ(record()->uuid(), uuid);
  EXPECT_EQ(registrar->knowledgeUUID(), knowledge);
}

TEST(RegistrarQuery, FilterSeesEachCandidateOnceAndRulesNeverDropAMatch) {
  PlatformRoot root;
  const std::string app = root.makeApp(root.appRoot(), "App", "com.example.app");
  PlatformRoot::makePlugIn(app, "A", "com.example.a", "1", R"(, "XTExtensionAttributes": {"Kind": "thumb"})");
  PlatformRoot::makePlugIn(app, "B", "com.example.b", "1", R"(, "XTExtensionAttributes": {"Kind": ["x", "share"]})");
  PlatformRoot::makePlugIn(app, "C", "com.example.c007", "1", R"(, "XTExtensionAttributes": {"Level": 3})");
  auto registrar = root.open(quiet());

  const auto query = [&](const tn::Value& rules) {
    std::vector<std::string> seen;
    std::vector<std::string> kept;
    const std::optional<PlugInList> found =
        registrar->queryPlugIns(rules, [&](const std::string& identifier, const tn::Value& entitlements) {
          EXPECT_TRUE(entitlements.isDictionary());
          seen.push_back(identifier);
          return identifier != "com.example.b";
        });
    EXPECT_TRUE(found);
    for (const PlugInPtr& plugIn : *found) kept.push_back(plugIn->identifier());
    return std::make_pair(seen, kept);
  };
  using Names = std::vector<std::string>;
  EXPECT_EQ(query(tn::Value()).first, (Names{"com.example.a", "com.example.b", "com.example.c007"}));
  EXPECT_EQ(query(tn::Value()).second, (Names{"com.example.a", "com.example.c007"}));
  EXPECT_EQ(query(tn::Dictionary{{"XTExtensionIdentifier", "com.example.c7"}}).first, (Names{"com.example.c007"}));
  EXPECT_EQ(query(tn::Dictionary{{"XTExtensionIdentifier", tn::Array{"=com.example.a", "com.example.b"}}}).first,
            (Names{"com.example.a", "com.example.b"}));
  EXPECT_EQ(query(tn::Dictionary{{"Kind", "share"}}).first, (Names{"com.example.b"}));
  EXPECT_EQ(query(tn::Dictionary{{"Level", true}}).first, (Names{"com.example.c007"}));
  EXPECT_EQ(query(tn::Dictionary{{"Level", false}}).first, (Names{"com.example.a", "com.example.b"}));
  // Comparisons and election rules are the daemon's: nothing is narrowed.
  EXPECT_EQ(query(tn::Dictionary{{"XTExtensionIdentifier", "<>com.example.a"}, {"XTUserElection", "1"}}).first.size(),
            3u);
  EXPECT_FALSE(registrar->queryPlugIns(tn::Value("rules"), {}));
}

TEST(RegistrarStore, RestartKeepsUUIDsAndUnchangedRescansChangeNothing) {
  PlatformRoot root;
  const std::string app = root.makeApp(root.appRoot(), "App", "com.example.app");
  const std::string plugIn = PlatformRoot::makePlugIn(app, "P", "com.example.p");
  tn::UUID uuid;
  tn::UUID knowledge;
  {
    auto registrar = root.open(quiet());
    uuid = registrar->plugInForURL(tn::URL::fileURLWithPath(plugIn))->uuid();
    knowledge = registrar->knowledgeUUID();
    const tn::Result<ScanSummary> again = registrar->scan();
    ASSERT_TRUE(again.ok());
    EXPECT_FALSE(again->changed);
    // Rewritten with the same contents: read again, found equal.
    PlatformRoot::writePlugIn(plugIn, "com.example.p", "1");
    ASSERT_TRUE(registrar->scan().ok());
    EXPECT_EQ(registrar->knowledgeUUID(), knowledge);
    EXPECT_EQ(registrar->plugInForURL(tn::URL::fileURLWithPath(plugIn))->uuid(), uuid);
  }
  auto reopened = root.open(quiet());
  EXPECT_EQ(reopened->knowledgeUUID(), knowledge);
  EXPECT_EQ(reopened->plugInForURL(tn::URL::fileURLWithPath(plugIn))->uuid(), uuid);

  Registrar::Options readOnly;
  readOnly.mode = Registrar::Mode::ReadOnly;
  auto reader = root.open(readOnly);
  EXPECT_EQ(reader->plugInForUUID(uuid)->bundlePath(), plugIn);
  EXPECT_FALSE(reader->scan().ok());
}

TEST(RegistrarStore, CorruptOrForeignStoresAreMovedAsideAndRebuilt) {
  for (const std::string& contents : {std::string("this is not a database at all, just some text......"),
                                     std::string("SQLite format 3") + std::string(1, '\0') + std::string(200, 'x')}) {
    PlatformRoot root;
    const std::string app = root.makeApp(root.appRoot(), "App", "com.example.app");
    PlatformRoot::makePlugIn(app, "P", "com.example.p");
    writeFile(root.paths().storeFile, contents);

    Registrar::Options readOnly;
    readOnly.mode = Registrar::Mode::ReadOnly;
    EXPECT_FALSE(Registrar::open(root.paths(), readOnly).ok());

    tn::log::ScopedCaptureSink capture;
    Registrar::Options options = quiet();
    options.initialScan = Registrar::InitialScan::None;  // a rebuilt store is scanned all the same
    auto registrar = root.open(options);
    ASSERT_TRUE(registrar);
    EXPECT_EQ(registrar->installedPlugIns().size(), 1u);
    EXPECT_TRUE(capture->contains("rg", tn::log::Level::Error, "moved it to " + root.paths().storeFile + ".corrupt-"));
    size_t asides = 0;
    for (const auto& entry : std::filesystem::directory_iterator(root.path() + "/var/lib/tenon")) {
      asides += entry.path().filename().string().starts_with("registrar.sqlite3.corrupt-") ? 1 : 0;
    }
    EXPECT_EQ(asides, 1u);
  }
}

TEST(RegistrarStore, AnotherApplicationsDatabaseIsForeign) {
  PlatformRoot root;
  root.makeApp(root.appRoot(), "App", "com.example.app");
  {
    auto registrar = root.open(quiet());
  }
  // Same file format, someone else's application id.
  sqlite3* db = nullptr;
  ASSERT_EQ(sqlite3_open(root.paths().storeFile.c_str(), &db), SQLITE_OK);
  EXPECT_EQ(sqlite3_exec(db, "PRAGMA application_id = 7", nullptr, nullptr, nullptr), SQLITE_OK);
  sqlite3_close(db);
  tn::log::ScopedCaptureSink capture;
  auto registrar = root.open(quiet());
  ASSERT_TRUE(registrar);
  EXPECT_TRUE(capture->contains("rg", tn::log::Level::Error, "not a registrar store (application id 7)"));
  EXPECT_TRUE(registrar->applicationForURL(tn::URL::fileURLWithPath(root.appRoot() + "/App")));
}

StoredPlugIn storedPlugIn(int n, tn::Value info) {
  StoredPlugIn plugIn;
  plugIn.uuid = tn::UUID::random();
  plugIn.path = fmt::format("/opt/P{}.tnx", n);
  plugIn.identifier = fmt::format("com.example.p{}", n);
  plugIn.info = std::move(info);
  plugIn.registered = tn::Date{1.5};
  return plugIn;
}

// Binds use the 64-bit sizes and are checked: a value the store refuses
// fails the whole write with SQLite's reason, and nothing of it is kept.
TEST(RegistrarStore, AValueTheStoreRefusesFailsTheWholeWrite) {
  PlatformRoot root;
  auto opened = Store::open(root.path() + "/store.sqlite3", Store::Mode::ReadWrite);
  ASSERT_TRUE(opened.ok()) << opened.error().description();
  Store& store = *opened->store;
  store.limitValueSize(4096);
  Store::Changes changes;
  changes.newKnowledge = tn::UUID::random();
  changes.putPlugIns = {storedPlugIn(1, tn::Value("small")), storedPlugIn(2, tn::Value(std::string(10000, 'x')))};
  const tn::Result<void> applied = store.apply(changes);
  ASSERT_FALSE(applied.ok());
  EXPECT_EQ(applied.error().code(), static_cast<int64_t>(RegistrarErrorCode::Store));
  EXPECT_NE(applied.error().message()->find("cannot store plug-in /opt/P2.tnx"), std::string::npos)
      << applied.error().description();
  const auto contents = store.load();
  ASSERT_TRUE(contents.ok());
  EXPECT_TRUE(contents->plugIns.empty()) << "the first plug-in was rolled back too";
  EXPECT_TRUE(contents->knowledge.isNil());

  changes.putPlugIns.pop_back();
  ASSERT_TRUE(store.apply(changes).ok());
  EXPECT_EQ(store.load()->plugIns.size(), 1u);
}

// A read that fails part-way (a damaged page) is an error, never a store
// with fewer records.
TEST(RegistrarStore, AReadThatFailsPartWayIsAnError) {
  PlatformRoot root;
  const std::string path = root.path() + "/store.sqlite3";
  {
    auto opened = Store::open(path, Store::Mode::ReadWrite);
    ASSERT_TRUE(opened.ok());
    Store::Changes changes;
    changes.newKnowledge = tn::UUID::random();
    for (int i = 0; i < 2000; ++i) changes.putPlugIns.push_back(storedPlugIn(i, tn::Value(std::string(200, 'i'))));
    ASSERT_TRUE(opened->store->apply(changes).ok());
  }
  // Damage the pages in the second half of the file (the last plug-ins' leaves).
  const auto size = std::filesystem::file_size(path);
  ASSERT_GT(size, 200000u);
  {
    std::fstream file(path, std::fstream::in | std::fstream::out | std::fstream::binary);
    for (std::uintmax_t page = size / 2 / 4096; page < size / 4096 - 1; page += 3) {
      file.seekp(static_cast<std::streamoff>(page * 4096));
      file.write(std::string(4096, '\xee').data(), 4096);
    }
  }
  const auto reopened = Store::open(path, Store::Mode::ReadOnly);
  EXPECT_FALSE(reopened.ok()) << reopened->contents.plugIns.size() << " plug-ins read";
}

}  // namespace
}  // namespace registrar::test
