// A plug-in database over a real registrar on a private $TENON_ROOT, for
// the tests of tenond/database and tenond/plugin.

#pragma once

#include <gtest/gtest.h>

#include <cstdlib>
#include <memory>
#include <string>

#include "platform/dispatch/SerialQueue.h"
#include "platform/log/Log.h"
#include "tenond/database/TNDatabase.h"
#include "tests/platform/registrar/RegistrarTestSupport.h"

namespace tnd::test {

// TNDatabase with its initialiser opened up; locale changes arrive on a
// private queue instead of the main queue.
class TestDatabase final : public TNDatabase {
 public:
  static std::shared_ptr<TestDatabase> open(const std::optional<std::string>& annotationsPath,
                                            std::shared_ptr<tn::dispatch::SerialQueue> localeQueue = nullptr) {
    std::shared_ptr<TestDatabase> database(new TestDatabase());
    if (!database->initWithDatabase(annotationsPath, std::move(localeQueue))) return nullptr;
    return database;
  }

 private:
  TestDatabase() = default;
};

// A delegate that keeps what it was told.
class RecordingDelegate final : public TNDatabaseDelegate {
 public:
  void removedPlugIns(const registrar::PlugInList& records) override {
    const std::lock_guard lock(mutex);
    batches.push_back(records);
  }
  std::mutex mutex;
  std::vector<registrar::PlugInList> batches;
};

// The daemon's record of the registrar's `record`, with `entitlements` and
// `dataContainer` in place of the registrar's (tests choose what the code
// signature and the container would say); null when the daemon refuses it.
inline std::shared_ptr<TNDPlugIn> daemonRecord(const registrar::PlugInPtr& record,
                                               const std::shared_ptr<registrar::Registrar>& registrar,
                                               const tn::TNRegistryLookup& lookup, const tn::Value& entitlements,
                                               std::optional<std::string> dataContainer) {
  registrar::PlugInRecord::Fields fields{record->uuid(), record->bundlePath(), record->containingApp(),
                                         record->bundleIdentifier(), record->identifier(), record->bundleVersion(),
                                         record->plugInDictionary(), record->infoDictionary(),
                                         record->registrationDate(), record->onSystemPartition(),
                                         record->localizedName(), record->localizedShortName(), entitlements,
                                         std::move(dataContainer), record->registeredByURL()};
  return TNDPlugIn::initWithRGData(std::make_shared<registrar::PlugInRecord>(std::move(fields)), registrar, lookup);
}

// Info and debug lines of the categories the database logs on, so that
// tests can look for them.
inline void enableAllLogLevels() {
  for (tn::log::Log* log : {&tn::log::ops(), &tn::log::rg(), &tn::log::sandbox()}) log->setEnabledLevels(~0u);
}

// A platform root whose path is TENON_ROOT for the test's duration.
class DatabaseRoot : public registrar::test::PlatformRoot {
 public:
  DatabaseRoot() {
    ::setenv("TENON_ROOT", path().c_str(), 1);
    enableAllLogLevels();
  }
  std::string annotationsPath() const { return path() + "/var/db/Tenon-Annotations"; }

  // An application with one plug-in, and optional extra plug-in keys.
  std::string makeAppWithPlugIn(const std::string& name, const std::string& identifier,
                                const std::string& extra = "", const std::string& protocol = "com.example.protocol") {
    const std::string app = makeApp(appRoot(), name, "com.example." + name);
    return makePlugIn(app, identifier + ".bundle", identifier, "1", extra, protocol);
  }
};

}  // namespace tnd::test
