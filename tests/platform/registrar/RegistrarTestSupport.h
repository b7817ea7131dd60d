// Temporary platform roots with applications and plug-ins for the registrar
// tests.

#pragma once

#include <gtest/gtest.h>

#include <fmt/format.h>

#include <memory>
#include <string>

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

}  // namespace registrar::test
