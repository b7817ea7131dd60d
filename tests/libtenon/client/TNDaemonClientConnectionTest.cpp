// The client's connection: which service it reaches, where and how reply
// blocks run, what it logs, and what reaches the blocks when the daemon is
// not there or goes away.

#include <gtest/gtest.h>

#include <atomic>
#include <mutex>
#include <thread>
#include <vector>

#include "libtenon/client/BlockingReply.h"
#include "libtenon/client/TNDaemonClient.h"
#include "platform/log/Log.h"
#include "platform/relay/RelayError.h"
#include "tests/libtenon/client/FakeDaemon.h"

namespace tn {
namespace {

using log::Level;
using test::FakeDaemon;

class ClientConnection : public ::testing::Test {
 protected:
  void TearDown() override { log::configure(""); }

  test::TempRoot root_;
  log::ScopedCaptureSink log_;
};

TEST_F(ClientConnection, WithoutANameTheClientReachesTheDaemonsService) {
  FakeDaemon daemon("com.ostrel.tenon.tenond");
  TNDaemonClient client;
  EXPECT_EQ(client.serviceName(), "com.ostrel.tenon.tenond");
  EXPECT_EQ(client.protocolVersion(), 3u);
  EXPECT_TRUE(client.sendAndWait(client.request("match"), test::kPatience));
  EXPECT_EQ(daemon.waitForRequests(1).size(), 1u);
}

TEST_F(ClientConnection, ReplyBlocksRunOneAtATimeOnTheClientsReplyQueue) {
  FakeDaemon daemon("serial");
  TNDaemonClient client("serial");
  EXPECT_EQ(client.replyQueue()->label(), "tenond_client");

  constexpr int kRequests = 200;
  std::atomic<int> running{0};
  std::atomic<int> overlaps{0};
  std::atomic<int> offQueue{0};
  std::vector<BlockingReply> pending(kRequests);
  for (int i = 0; i < kRequests; ++i) {
    auto done = pending[i].block();
    client.bulkPlugins(static_cast<uint64_t>(i), [&, done](relay::Reply reply) {
      if (running.fetch_add(1) != 0) overlaps.fetch_add(1);
      if (!client.replyQueue()->isCurrent()) offQueue.fetch_add(1);
      std::this_thread::yield();  // give a concurrent block the chance to show itself
      running.fetch_sub(1);
      done(std::move(reply));
    });
  }
  for (auto& reply : pending) EXPECT_TRUE(reply.wait(test::kPatience));
  EXPECT_EQ(overlaps.load(), 0);
  EXPECT_EQ(offQueue.load(), 0);
}

TEST_F(ClientConnection, WithoutADaemonTheBlockGetsTheConnectionErrorLaterOnTheReplyQueue) {
  TNDaemonClient client("absent");
  const auto sender = std::this_thread::get_id();
  std::atomic<bool> onSenderThread{true};
  std::atomic<bool> onReplyQueue{false};
  BlockingReply pending;
  auto done = pending.block();
  client.bulkPlugins(0, [&, done](relay::Reply reply) {
    onSenderThread = std::this_thread::get_id() == sender;
    onReplyQueue = client.replyQueue()->isCurrent();
    done(std::move(reply));
  });
  const relay::Reply reply = pending.wait(test::kPatience);
  ASSERT_FALSE(reply);
  EXPECT_TRUE(relay::isRelayError(reply.error(), relay::RelayErrorCode::ServiceUnavailable))
      << reply.error().description();
  EXPECT_FALSE(onSenderThread);
  EXPECT_TRUE(onReplyQueue);
  const auto error = TNDaemonClient::errorInReply(reply);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code(), 4);
  EXPECT_EQ(error->localizedDescription(), reply.error().localizedDescription());
}

TEST_F(ClientConnection, ADaemonThatStartsLaterIsReachedByTheNextSend) {
  TNDaemonClient client("late");
  EXPECT_EQ(client.tenond(), nullptr);
  EXPECT_FALSE(client.sendAndWait(client.request("bulk"), test::kPatience));

  FakeDaemon daemon("late");
  EXPECT_TRUE(client.sendAndWait(client.request("bulk"), test::kPatience));
  EXPECT_NE(client.tenond(), nullptr);
}

TEST_F(ClientConnection, RequestsAndRepliesAreLoggedOnTrafficAtDebugLevel) {
  log::configure("traffic=debug");
  FakeDaemon daemon("logged", [](const Value&) { return Value(Dictionary{{"answer", Value(uint64_t{42})}}); });
  TNDaemonClient client("logged");
  ASSERT_TRUE(client.sendAndWait(client.request("bulk"), test::kPatience));
  EXPECT_TRUE(log_->contains("traffic", Level::Debug, R"(request: {request: "bulk", version: 3})"))
      << ::testing::PrintToString(log_->lines());
  EXPECT_TRUE(log_->contains("traffic", Level::Debug, "reply: {answer: 42}"))
      << ::testing::PrintToString(log_->lines());
}

TEST_F(ClientConnection, LookupsAreLoggedAtDefaultLevelBeforeSending) {
  TNDaemonClient client("lookups");
  const UUID uuid = *UUID::parse("E621E1F8-C36C-495A-93FC-0C247A3E6E5F");
  client.findPlugInByUUID(uuid, [](relay::Reply) {});
  client.findPlugInByPathURL(URL::fileURLWithPath("/opt/A.tnx"), [](relay::Reply) {});
  EXPECT_EQ(log_->count("ops", Level::Default, "findPlugInByUUID E621E1F8-C36C-495A-93FC-0C247A3E6E5F"), 1u);
  EXPECT_EQ(log_->count("ops", Level::Default, "findPlugInByPathURL file:///opt/A.tnx"), 1u);
}

TEST_F(ClientConnection, ADaemonThatGoesAwayIsReportedAsACommunicationsError) {
  auto daemon = std::make_unique<FakeDaemon>("going");
  TNDaemonClient client("going");
  ASSERT_TRUE(client.sendAndWait(client.request("bulk"), test::kPatience));
  daemon.reset();
  EXPECT_TRUE(test::eventually([&] { return log_->contains("ops", Level::Error, "Communications error: "); }))
      << ::testing::PrintToString(log_->lines());
}

TEST_F(ClientConnection, ReleasingTheClientEndsPendingRequestsQuietly) {
  FakeDaemon daemon("silent", [](const Value&) { return Value(); });  // never answers
  BlockingReply pending;
  {
    TNDaemonClient client("silent");
    client.bulkPlugins(0, pending.block());
    daemon.waitForRequests(1);
  }
  const relay::Reply reply = pending.wait(test::kPatience);
  ASSERT_FALSE(reply);
  EXPECT_TRUE(relay::isRelayError(reply.error(), relay::RelayErrorCode::ConnectionInvalid))
      << reply.error().description();
  EXPECT_EQ(log_->count("ops", Level::Error, "Communications error"), 0u);
}

TEST_F(ClientConnection, SendAndWaitGivesUpWithATimeoutError) {
  FakeDaemon daemon("slow", [](const Value&) { return Value(); });  // never answers
  TNDaemonClient client("slow");
  const relay::Reply reply = client.sendAndWait(client.request("bulk"), std::chrono::milliseconds(50));
  ASSERT_FALSE(reply);
  EXPECT_TRUE(isTimedOut(reply.error())) << reply.error().description();
  EXPECT_EQ(TNDaemonClient::errorInReply(reply)->code(), 4);
}

}  // namespace
}  // namespace tn
