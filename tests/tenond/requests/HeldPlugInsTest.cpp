// "ready" and "access" against plug-ins on hold, in-process: a real server on
// a private TENON_ROOT with its process supervisor, a hold placed through the
// server's hold list (as "lock" places one), and transactions made straight
// from request dictionaries. "ready" checks every plug-in before it enables
// any, so a hold on the second leaves the first unregistered; "access" does
// not look at holds.

#include <gtest/gtest.h>

#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "platform/warden/Warden.h"
#include "tenond/requests/Transaction.h"
#include "tenond/server/TNDPlugInHold.h"
#include "tenond/server/TNDServer.h"
#include "tests/platform/bundle/BundleTestSupport.h"
#include "tests/tenond/requests/InProcessClient.h"

namespace tnd {
namespace {

namespace fs = std::filesystem;
using tn::Array;
using tn::Dictionary;
using tn::UUID;
using tn::Value;

class HeldPlugIns : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    root_ = fs::temp_directory_path() / ("tenond-held-test-" + std::to_string(getpid()));
    fs::create_directories(root_);
    ::setenv("TENON_ROOT", root_.c_str(), 1);
    const fs::path app = root_ / "opt/tenon/applications/Tools";
    tn::test::makeBundle(app.string(), R"({"BNBundleIdentifier": "com.example.tools"})");
    for (const char* name : {"First", "Second"}) {
      const fs::path plugIn = app / "Support/PlugIns" / name;
      tn::test::makeBundle(plugIn.string(), std::string(R"({"BNBundleIdentifier": "com.example.tools.)") + name +
                                                R"(", "BNBundleExecutable": "run", "XTExtension": {
                                                "XTExtensionPointIdentifier": "com.example.p",
                                                "XTExtensionProtocol": "com.example.protocol",
                                                "XTExtensionAttributes": {}}})");
      fs::create_directories(plugIn / "bin");
      std::ofstream(plugIn / "bin/run") << "#!/bin/sh\n";
      fs::permissions(plugIn / "bin/run", fs::perms(0755));
      paths_.push_back(plugIn.string());
    }
    server_ = TNDServer::initForService("held.test", std::nullopt);
    ASSERT_TRUE(server_);
    for (const std::string& path : paths_) {
      const registrar::PlugInPtr record = server_->workspace()->plugInForURL(tn::URL::fileURLWithPath(path));
      ASSERT_TRUE(record) << path;
      uuids_.push_back(record->uuid());
    }
    connected_ = test::connectInProcessClient(server_, "held.test.pair");
  }
  static void TearDownTestSuite() {
    connected_ = {};
    fs::remove_all(root_);
  }

  static Value run(Dictionary body) {
    body.set("version", 3u);
    body.set("uuids", Value(Array{Value(uuids_[0]), Value(uuids_[1])}));
    Transaction transaction(relay::Message{1, Value(std::move(body)), {}, nullptr}, connected_.client);
    transaction.dispatch();
    return Value(transaction.reply());
  }

  static inline fs::path root_;
  static inline std::vector<std::string> paths_;
  static inline std::vector<UUID> uuids_;
  static inline std::shared_ptr<TNDServer> server_;
  static inline test::InProcessClient connected_;
};

TEST_F(HeldPlugIns, ReadyRefusesAHeldPlugInAndEnablesNoneOfTheOthers) {
  ASSERT_EQ(server_->warden()->registrationCount(), 0u);
  const auto hold = std::make_shared<TNDPlugInHold>(std::vector<UUID>{uuids_[1]}, connected_.client);
  server_->addHold(hold);
  const Value refused = run({{"request", "ready"}});
  EXPECT_EQ(refused["errorcode"], Value(11u)) << refused;
  EXPECT_EQ(refused["error"], Value("access to plugin com.example.tools.Second denied: the plug-in is on hold"));
  EXPECT_EQ(server_->warden()->registrationCount(), 0u) << "the first was checked, never enabled";

  // "access" does not look at holds: a token for each, in order.
  const Value tokens = run({{"request", "access"}});
  ASSERT_TRUE(tokens["errorcode"].isNull()) << tokens;
  EXPECT_EQ(tokens["extensions"].array()->size(), 2u);

  server_->unholdToken(hold->uuid());
  const Value readied = run({{"request", "ready"}});
  EXPECT_TRUE(readied["errorcode"].isNull()) << readied;
  EXPECT_EQ(server_->warden()->registrationCount(), 2u) << "both, once the hold is gone";
}

}  // namespace
}  // namespace tnd
