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

#include "platform/vigil/Vigil.h"
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
      // Their program is the example plug-in, which answers line by line
      // and declares itself busy while it works ("hold" until "release").
      fs::create_directories(plugIn / "bin");
      fs::copy_file(TENON_BINARY_DIR "/examples/plugins/upcase/upcase", plugIn / "bin/run");
      fs::permissions(plugIn / "bin/run", fs::perms(0755));
      paths_.push_back(plugIn.string());
    }
    const fs::path profiles = root_ / "usr/share/tenon/sandbox-profiles";
    fs::create_directories(profiles);
    for (const auto& profile : fs::directory_iterator(TENON_SOURCE_DIR "/packaging/sandbox-profiles")) {
      fs::copy_file(profile.path(), profiles / profile.path().filename());
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

// What a running instance declares is what checkBusy sees: this process is
// the host, readies the plug-ins, has the supervisor start one and makes it
// busy; the daemon's record asks the busy-assertion service.
TEST_F(HeldPlugIns, CheckBusySeesWhatARunningInstanceDeclares) {
  ASSERT_TRUE(run({{"request", "ready"}})["errorcode"].isNull());
  auto started = server_->warden()->start(connected_.client->peerIdentity().auditToken, "com.example.tools.First");
  ASSERT_TRUE(started.ok()) << started.error().description();
  const int plugIn = started->hostSocket.get();
  const auto say = [plugIn](const std::string& line) {
    const std::string text = line + "\n";
    EXPECT_EQ(::write(plugIn, text.data(), text.size()), static_cast<ssize_t>(text.size()));
    std::string answer;
    for (char c = 0; ::read(plugIn, &c, 1) == 1 && c != '\n';) answer.push_back(c);
    return answer;
  };
  const std::shared_ptr<TNDPlugIn> record = server_->findPlugIn(uuids_[0]);
  ASSERT_TRUE(record);
  const auto busyInstances = [](const std::set<std::string>& identifiers) {
    return server_->vigil()->busyInstances(identifiers);
  };
  EXPECT_FALSE(record->checkBusy(busyInstances));
  ASSERT_EQ(say("hold"), "busy");
  EXPECT_EQ(record->checkBusy(busyInstances), Value(Dictionary{{"BNBundleIdentifier", "com.example.tools.First"}}));
  ASSERT_EQ(say("release"), "idle");
  EXPECT_FALSE(record->checkBusy(busyInstances));
}

}  // namespace
}  // namespace tnd
