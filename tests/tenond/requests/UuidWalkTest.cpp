// The walk over a request's `uuids` (Transaction::processUuidList), which
// the requests acting on listed plug-ins are built on, driven with a fake
// per-plug-in operation: a real server in this process on a private
// TENON_ROOT with three installed data plug-ins, and transactions made
// straight from request dictionaries (their replies go nowhere; the test
// reads them from the transaction).

#include <gtest/gtest.h>

#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <future>

#include "platform/log/CaptureSink.h"
#include "platform/log/Log.h"
#include "platform/relay/Listener.h"
#include "tenond/requests/Transaction.h"
#include "tenond/server/TNDRelayClient.h"
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

class UuidWalk : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    root_ = fs::temp_directory_path() / ("tenond-walk-test-" + std::to_string(getpid()));
    fs::create_directories(root_);
    ::setenv("TENON_ROOT", root_.c_str(), 1);
    const std::string app = (root_ / "opt/tenon/applications/Notes").string();
    tn::test::makeBundle(app, R"({"BNBundleIdentifier": "com.example.notes"})");
    for (const char* name : {"One", "Two", "Three"}) {
      paths_.push_back(app + "/Support/PlugIns/" + name);
      tn::test::makeBundle(paths_.back(), std::string(R"({"BNBundleIdentifier": "com.example.notes.)") + name +
                                              R"(", "XTExtension": {"XTExtensionPointIdentifier": "com.example.p",
                                              "XTExtensionProtocol": "#Data", "XTExtensionAttributes": {}}})");
    }
    tn::log::configure("debug");
    server_ = TNDServer::initForService("walk.test", std::nullopt);
    ASSERT_TRUE(server_);
    server_->service()->resume();
    for (const std::string& path : paths_) {
      const registrar::PlugInPtr record = server_->workspace()->plugInForURL(tn::URL::fileURLWithPath(path));
      ASSERT_TRUE(record) << path;
      uuids_.push_back(record->uuid());
    }
    client_ = connectClient();
  }
  static void TearDownTestSuite() {
    client_.reset();
    fs::remove_all(root_);
  }

  // The daemon's client object for a connection from this process.
  static std::shared_ptr<TNDRelayClient> connectClient() {
    test::InProcessClient connected = test::connectInProcessClient(server_, "walk.test.pair");
    peer_ = connected.peer;
    return connected.client;
  }

  // Walks `body` (with the envelope added) handing each plug-in's
  // identifier to `seen`; the operation answers false for `stopAt`.
  struct Walk {
    bool result = false;
    std::vector<std::string> seen;
    Value reply;
  };
  static Walk walk(Dictionary body, const std::string& stopAt = "") {
    body.set("request", "ready");
    body.set("version", 3u);
    Transaction transaction(relay::Message{1, Value(std::move(body)), {}, nullptr}, client_);
    Walk walked;
    walked.result = transaction.processUuidList([&](const std::shared_ptr<TNDPlugIn>& plugIn) {
      walked.seen.push_back(plugIn->identifier().value_or(""));
      if (walked.seen.back() != stopAt) return true;
      transaction.fail(99, std::string("stopped by the operation"));
      return false;
    });
    walked.reply = Value(transaction.reply());
    return walked;
  }

  static Value uuidArray(const std::vector<UUID>& uuids) {
    Array array;
    for (const UUID& uuid : uuids) array.emplace_back(uuid);
    return Value(std::move(array));
  }

  static inline fs::path root_;
  static inline std::vector<std::string> paths_;
  static inline std::vector<UUID> uuids_;
  static inline std::shared_ptr<TNDServer> server_;
  static inline std::shared_ptr<relay::Connection> peer_;
  static inline std::shared_ptr<TNDRelayClient> client_;
};

const std::string kOne = "com.example.notes.One", kTwo = "com.example.notes.Two", kThree = "com.example.notes.Three";

void expectFailure(const Value& reply, const std::string& message) {
  EXPECT_EQ(reply["errorcode"], Value(4u)) << reply;
  EXPECT_EQ(reply["error"], Value(message)) << reply;
}

TEST_F(UuidWalk, HandsOverEveryPlugInInOrderAndLeavesTheReplyToTheCaller) {
  const Walk walked = walk({{"uuids", uuidArray({uuids_[2], uuids_[0], uuids_[2]})}});
  EXPECT_TRUE(walked.result);
  EXPECT_EQ(walked.seen, (std::vector<std::string>{kThree, kOne, kThree}));
  EXPECT_EQ(walked.reply, Value(Dictionary{}));

  const Walk empty = walk({{"uuids", Value(Array{})}});
  EXPECT_TRUE(empty.result);
  EXPECT_TRUE(empty.seen.empty());
  EXPECT_EQ(empty.reply, Value(Dictionary{}));
}

TEST_F(UuidWalk, StopsAtTheFirstFailureAfterHandingOverWhatCameBefore) {
  const Walk unknown = walk({{"uuids", uuidArray({uuids_[0], UUID::random(), uuids_[2]})}});
  EXPECT_FALSE(unknown.result);
  EXPECT_EQ(unknown.seen, std::vector<std::string>{kOne});
  expectFailure(unknown.reply, "no such plugin (uuid not found)");

  const Walk badElement = walk({{"uuids", Value(Array{Value(uuids_[1]), Value(uuids_[0].string())})}});
  EXPECT_FALSE(badElement.result);
  EXPECT_EQ(badElement.seen, std::vector<std::string>{kTwo});
  expectFailure(badElement.reply, "invalid request (bad uuid array)");

  for (const Value& notArray : {Value(), Value(uuids_[0]), Value(Dictionary{})}) {
    Dictionary body;
    if (!notArray.isNull()) body.set("uuids", notArray);
    const Walk walked = walk(body);
    EXPECT_FALSE(walked.result);
    EXPECT_TRUE(walked.seen.empty());
    expectFailure(walked.reply, "invalid request format (uuid)");
  }
}

TEST_F(UuidWalk, AnOperationThatAnswersFalseStopsTheWalkWithItsOwnReply) {
  const Walk walked = walk({{"uuids", uuidArray({uuids_[0], uuids_[1], uuids_[2]})}}, kTwo);
  EXPECT_FALSE(walked.result);
  EXPECT_EQ(walked.seen, (std::vector<std::string>{kOne, kTwo}));
  EXPECT_EQ(walked.reply["errorcode"], Value(99u)) << "the walk adds no reply of its own";
  EXPECT_EQ(walked.reply["error"], Value("stopped by the operation"));
}

TEST_F(UuidWalk, AnUnknownUuidFallsBackToTheFileSystemPathBesideIt) {
  tn::log::ScopedCaptureSink capture;
  const UUID unknown = UUID::random();
  const Walk walked = walk({{"uuids", uuidArray({unknown, uuids_[0]})},
                            {"paths", Value(Array{Value(paths_[1]), Value("/ignored")})}});
  EXPECT_TRUE(walked.result);
  EXPECT_EQ(walked.seen, (std::vector<std::string>{kTwo, kOne})) << "whatever the plug-in's own UUID";
  EXPECT_TRUE(capture->contains("traffic", tn::log::Level::Info, "Failed to find plugin by " + unknown.string()));
  EXPECT_TRUE(capture->contains("traffic", tn::log::Level::Info,
                                "Looking for plugin " + unknown.string() + " by path " + paths_[1]));

  // Not a URL: "file://" + path names nothing.
  const Walk url = walk({{"uuids", uuidArray({unknown})}, {"paths", Value(Array{Value("file://" + paths_[1])})}});
  expectFailure(url.reply, "no such plugin (uuid not found)");
  // A path element that is not a string resolves nothing either.
  const Walk number = walk({{"uuids", uuidArray({unknown})}, {"paths", Value(Array{Value(7)})}});
  expectFailure(number.reply, "no such plugin (uuid not found)");
}

TEST_F(UuidWalk, PathsOfAnotherCountOrKindAreIgnoredAndLogged) {
  tn::log::ScopedCaptureSink capture;
  const UUID unknown = UUID::random();
  const Walk shorter = walk({{"uuids", uuidArray({uuids_[0], uuids_[1], unknown})},
                             {"paths", Value(Array{Value(paths_[2]), Value(paths_[2])})}});
  EXPECT_EQ(shorter.seen, (std::vector<std::string>{kOne, kTwo}));
  expectFailure(shorter.reply, "no such plugin (uuid not found)");
  EXPECT_TRUE(capture->contains("traffic", tn::log::Level::Default,
                                "Paths present but has different count than UUIDs (ignoring)"));

  const Walk notArray = walk({{"uuids", uuidArray({unknown})}, {"paths", Value(paths_[2])}});
  expectFailure(notArray.reply, "no such plugin (uuid not found)");
  EXPECT_TRUE(capture->contains("traffic", tn::log::Level::Default, "Paths present but not an array (ignoring values)"));
}

}  // namespace
}  // namespace tnd
