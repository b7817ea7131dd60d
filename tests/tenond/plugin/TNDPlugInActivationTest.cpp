// Activation on real daemon plug-in records: the merged environment in its
// order (host, data container, the bundle's own), the service configuration
// and overlay keys, the sandbox profile table with the open-access rule, the
// two failures with their messages, and checkBusy over what the busy-instance
// source answers. The supervisor here is a recording function; the real one
// (platform/warden) is exercised end to end by tests/e2e.

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "platform/log/CaptureSink.h"
#include "platform/privy/ConsentStore.h"
#include "platform/value/MessageValue.h"
#include "tests/support/TrustedInstall.h"
#include "tests/tenond/database/DatabaseTestSupport.h"

namespace tnd::test {
namespace {

using tn::Dictionary;
using tn::Value;

// A host that is only what activation asks of it.
class FakeHost : public TNDHost {
 public:
  int32_t pid() const override { return 4242; }
  std::string executablePath() const override { return "/opt/host/bin/host"; }
  Value entitlementValueForKey(const std::string&) const override { return Value(); }
  bool hasEntitlement(const std::string&) const override { return false; }
  std::shared_ptr<tn::TNBundle> bundle() const override { return nullptr; }
};

class Activation : public ::testing::Test {
 protected:
  // A plug-in in its own application: `plugInKeys` go into "XTExtension",
  // `topLevel` into the manifest itself (both JSON members, with a leading
  // comma).
  std::shared_ptr<TNDPlugIn> plugIn(const std::string& identifier, const std::string& plugInKeys,
                                    const std::string& topLevel = "", bool withContainer = true,
                                    const std::string& protocol = "com.example.protocol") {
    const std::string app = root_.makeApp(root_.appRoot(), identifier + "-app", "com.example.app." + identifier);
    const std::string bundle = app + "/Support/PlugIns/" + identifier + ".tnx";
    tn::test::makeBundle(bundle, R"({"BNBundleIdentifier": ")" + identifier +
                                     R"(", "BNBundleVersion": "1", "BNBundleExecutable": "run")" + topLevel +
                                     R"(, "XTExtension": {"XTExtensionProtocol": ")" + protocol + "\"" +
                                     (plugInKeys.find("XTExtensionAttributes") == std::string::npos
                                          ? R"(, "XTExtensionAttributes": {"Kind": "x"})"
                                          : "") +
                                     plugInKeys + "}}");
    std::filesystem::create_directories(bundle + "/bin");
    std::ofstream(bundle + "/bin/run") << "#!/bin/sh\n";
    if (!registrar_) {
      registrar_ = root_.open(registrar::test::quiet());
      lookup_ = std::make_unique<tn::RegistrarLookup>(registrar_);
    }
    EXPECT_TRUE(registrar_->scan().ok());
    const registrar::PlugInPtr record = registrar_->plugInForURL(tn::URL::fileURLWithPath(bundle));
    EXPECT_TRUE(record);
    return daemonRecord(record, registrar_, *lookup_, Value(Dictionary{}),
                        withContainer ? std::optional<std::string>("/data/" + identifier) : std::nullopt);
  }

  // The "RelayService" of the overlay, back in memory.
  static Dictionary service(const Value& overlay) {
    return *tn::convertMessageToMemory(overlay["RelayService"]).dictionary();
  }

  DatabaseRoot root_;
  std::shared_ptr<registrar::Registrar> registrar_;
  std::unique_ptr<tn::RegistrarLookup> lookup_;
  FakeHost host_;
};

TEST_F(Activation, TheEnvironmentMergesHostContainerAndBundleInThatOrder) {
  const auto plain = plugIn("com.example.plain", "");
  const Dictionary host{{"HOME", "/home/host"}, {"LANG", "C"}, {"TMPDIR", "/tmp/host"}};
  const Value overlay = plain->activationOverlay(host);
  EXPECT_EQ(overlay["BNBundlePackageType"], Value("RLY!"));
  const Dictionary configured = service(overlay);
  EXPECT_EQ(configured.get("_OmitSandboxParameters"), Value(true));
  EXPECT_EQ(configured.get("_SandboxProfile"), Value("plugin")) << "an extension point in no row";
  const Value environment = configured.get("EnvironmentVariables");
  EXPECT_EQ(environment["HOME"], Value("/data/com.example.plain")) << "the container replaces the host's HOME";
  EXPECT_EQ(environment["BNFIXED_USER_HOME"], Value("/data/com.example.plain"));
  EXPECT_EQ(environment["TMPDIR"], Value("/data/com.example.plain/tmp"));
  EXPECT_EQ(environment["LANG"], Value("C"));

  // The bundle's own variables win over everything, and its own profile is
  // replaced.
  const auto own = plugIn("com.example.own", "",
                          R"(, "RelayService": {"_SandboxProfile": "none", "Keep": 1,
                               "EnvironmentVariables": {"TMPDIR": "/bundle/tmp"}})");
  const Dictionary ownService = service(own->activationOverlay(host));
  EXPECT_EQ(ownService.get("_SandboxProfile"), Value("plugin"));
  EXPECT_EQ(ownService.get("Keep"), Value(1));
  EXPECT_EQ(ownService.get("EnvironmentVariables")["TMPDIR"], Value("/bundle/tmp"));

  // Without a container (only data plug-ins have none) the host's HOME stays.
  const auto data = plugIn("com.example.data", "", "", false, "#Data");
  ASSERT_TRUE(data);
  EXPECT_EQ(data->mergedEnvironment(host).get("HOME"), Value("/home/host"));
}

TEST_F(Activation, TheProfileTableAndTheOpenAccessRuleBothWays) {
  const std::string entryPad = R"(, "XTExtensionPointIdentifier": "com.ostrel.entry-pad-service")";
  EXPECT_EQ(plugIn("com.example.pad", entryPad)->sandboxProfile(), "entry-pad");
  const std::string asking = R"(, "XTExtensionPointIdentifier": "com.ostrel.entry-pad-service",
                                 "XTExtensionAttributes": {"RequestsOpenAccess": true})";
  const auto open = plugIn("com.example.open", asking);
  EXPECT_EQ(open->sandboxProfile(), "entry-pad") << "asking is not enough without the grant";
  const privy::ConsentStore consent;
  tn::test::trustDirectoriesBetween(root_.path(), consent.path());
  ASSERT_TRUE(consent.setConsent("com.example.app.com.example.open", TNDPlugIn::kEntryPadNetworkService, true).ok());
  EXPECT_EQ(open->sandboxProfile(), "plugin");
  EXPECT_EQ(plugIn("com.example.screen", R"(, "XTExtensionPointIdentifier": "com.ostrel.trafficguard.screen-data")")
                ->sandboxProfile(),
            "traffic-screen");
  EXPECT_EQ(plugIn("com.example.sieve", R"(, "XTExtensionPointIdentifier": "com.ostrel.callerscope.note-sieve")")
                ->sandboxProfile(),
            "note-sieve");
}

TEST_F(Activation, EnablingRegistersTheExecutableOrSaysWhyNot) {
  const auto plain = plugIn("com.example.run", "");
  std::string registered;
  Value overlay;
  EXPECT_FALSE(plain->enableForClient(host_, std::nullopt, [&](const std::string& path, const Value& given) {
    registered = path;
    overlay = given;
    return 0;
  }));
  EXPECT_TRUE(registered.ends_with("/com.example.run.tnx/bin/run")) << registered;
  EXPECT_EQ(overlay["BNBundlePackageType"], Value("RLY!"));

  const std::optional<tn::Error> refused =
      plain->enableForClient(host_, std::nullopt, [](const std::string&, const Value&) { return EPERM; });
  ASSERT_TRUE(refused);
  EXPECT_EQ(refused->code(), 4);
  EXPECT_EQ(refused->message(), "unable to enable plug-in com.example.run(" + plain->uuid()->string() + ")");
}

TEST_F(Activation, CheckBusySkipsInstancesWithoutABundleIdentifier) {
  const auto plain = plugIn("com.example.busy", "");
  std::set<std::string> asked;
  const auto busy = plain->checkBusy([&](const std::set<std::string>& identifiers) {
    asked = identifiers;
    return std::vector<Value>{Value(Dictionary{{"pid", 1}}),
                              Value(Dictionary{{"BNBundleIdentifier", "com.example.busy"}, {"pid", 2}})};
  });
  EXPECT_EQ(asked, (std::set<std::string>{"com.example.busy"}));
  ASSERT_TRUE(busy);
  EXPECT_EQ(*busy, Value(Dictionary{{"BNBundleIdentifier", "com.example.busy"}}));
  EXPECT_FALSE(plain->checkBusy([](const std::set<std::string>&) { return std::vector<Value>{}; }));
}

}  // namespace
}  // namespace tnd::test
