// Temporary platform roots with applications and plug-ins for the registrar
// tests.

#pragma once

#include <gtest/gtest.h>

#include <fmt/format.h>

#include <atomic>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/dispatch/Semaphore.h"
#include "platform/registrar/Registrar.h"
#include "tests/platform/bundle/BundleTestSupport.h"

namespace registrar::test {

// A private $TENON_ROOT with the default application roots.
class PlatformRoot {
 public:
  PlatformRoot() : paths_(RegistrarPaths::forRoot(directory_.path())) {
    for (const std::string& root : paths_.applicationRoots) tn::test::makeDirectory(root);
  }

  const RegistrarPaths& paths() const { return paths_; }
  const std::string& path() const { return directory_.path(); }
  std::string appRoot() const { return paths_.applicationRoots[2]; }      // opt/tenon/applications
  std::string systemRoot() const { return paths_.applicationRoots[0]; }   // System/Applications

  // An application bundle named name (".app"-less directory) in root.
  std::string makeApp(const std::string& root, const std::string& name, const std::string& identifier) const {
    const std::string app = root + "/" + name;
    tn::test::makeBundle(app, fmt::format(R"({{"BNBundleIdentifier": "{}", "BNBundleDisplayName": "{}"}})",
                                          identifier, name));
    return app;
  }

  // A plug-in bundle in the application's Support/PlugIns.
  static std::string makePlugIn(const std::string& app, const std::string& name, const std::string& identifier,
                                const std::string& version = "1", const std::string& extra = "",
                                const std::string& protocol = "com.example.protocol") {
    const std::string plugIn = app + "/Support/PlugIns/" + name;
    writePlugIn(plugIn, identifier, version, extra, protocol);
    return plugIn;
  }

  static void writePlugIn(const std::string& plugIn, const std::string& identifier, const std::string& version,
                          const std::string& extra = "", const std::string& protocol = "com.example.protocol") {
    // extra may bring its own attributes instead of the default ones.
    const std::string attributes =
        extra.find("XTExtensionAttributes") == std::string::npos ? R"(, "XTExtensionAttributes": {"Kind": "thumb"})" : "";
    tn::test::makeBundle(
        plugIn, fmt::format(R"({{"BNBundleIdentifier": "{0}", "BNBundleVersion": "{1}", "BNBundleName": "{0}",
          "XTExtension": {{"XTExtensionPointIdentifier": "com.example.thumbnails",
            "XTExtensionProtocol": "{2}"{3}{4}}}}})",
                            identifier, version, protocol, attributes, extra));
  }

  std::shared_ptr<Registrar> open(Registrar::Options options = {}) const {
    if (!options.locale) options.locale = "";
    tn::Result<std::shared_ptr<Registrar>> opened = Registrar::open(paths_, options);
    EXPECT_TRUE(opened.ok()) << (opened.ok() ? "" : opened.error().description());
    return opened.ok() ? *opened : nullptr;
  }

 private:
  tn::test::TempDirectory directory_;
  RegistrarPaths paths_;
};

inline Registrar::Options quiet() {
  Registrar::Options options;
  options.watch = false;
  return options;
}

// Records every batch as "+id" / "-id" lines, one vector per batch, and
// whether an uninstalled plug-in could still be looked up when told.
class RecordingObserver : public RegistrarObserver {
 public:
  // Without a registrar, uninstalled records are not looked up.
  explicit RecordingObserver(std::shared_ptr<Registrar> registrar = nullptr) : registrar_(std::move(registrar)) {}

  void pluginsDidInstall(const PlugInList& plugIns) override { record('+', plugIns); }
  void pluginsWillUninstall(const PlugInList& plugIns) override {
    for (const PlugInPtr& plugIn : plugIns) {
      if (registrar_ && registrar_->plugInForUUID(plugIn->uuid()) != plugIn) stillVisible_ = false;
    }
    record('-', plugIns);
  }

  std::vector<std::vector<std::string>> batches() {
    const std::lock_guard lock(mutex_);
    return batches_;
  }
  bool uninstalledStayedVisible() const { return stillVisible_; }
  tn::dispatch::Semaphore delivered;

 private:
  void record(char sign, const PlugInList& plugIns) {
    std::vector<std::string> batch;
    for (const PlugInPtr& plugIn : plugIns) batch.push_back(sign + plugIn->identifier());
    {
      const std::lock_guard lock(mutex_);
      batches_.push_back(std::move(batch));
    }
    delivered.signal();
  }

  std::shared_ptr<Registrar> registrar_;
  std::mutex mutex_;
  std::vector<std::vector<std::string>> batches_;
  std::atomic<bool> stillVisible_{true};
};

using Batches = std::vector<std::vector<std::string>>;

}  // namespace registrar::test
