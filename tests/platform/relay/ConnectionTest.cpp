#include "platform/relay/Connection.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <optional>

#include "platform/dispatch/SerialQueue.h"
#include "platform/relay/ProcessStartTime.h"
#include "platform/relay/RelayError.h"
#include "tests/platform/relay/RelayTestSupport.h"

namespace relay {
namespace {

using test::Client;
using test::numbered;
using test::Recorder;
using test::Server;
using tn::dispatch::SerialQueue;

class ConnectionTest : public test::RelayTest {};

bool failedWith(const Reply& reply, RelayErrorCode code) { return !reply.ok() && isRelayError(reply.error(), code); }

TEST_F(ConnectionTest, ReplyRunsOnTheQueueTheSenderNamed) {
  Server server("echo", Server::echo);
  Client client("echo");
  const auto named = SerialQueue::create("named");
  Recorder<std::pair<Reply, bool>> replies;
  client.connection->sendWithReply(numbered(7), named, [&](Reply reply) { replies.add({reply, named->isCurrent()}); });
  const auto got = replies.waitFor(1).at(0);
  ASSERT_TRUE(got.first.ok());
  EXPECT_EQ((*got.first)["echo"]["n"], tn::Value(7));
  EXPECT_TRUE(got.second);
}

TEST_F(ConnectionTest, RepliesFindTheirRequestsWhateverOrderTheyComeIn) {
  Server server("reverse", nullptr);  // answered by the test, last request first
  Client client("reverse");
  constexpr uint64_t kCount = 20;
  Recorder<std::pair<uint64_t, Reply>> replies;
  for (uint64_t n = 0; n < kCount; ++n) {
    client.connection->sendWithReply(numbered(n), SerialQueue::create("replies"),
                                     [&replies, n](Reply reply) { replies.add({n, reply}); });
  }
  const auto requests = server.events(0).waitFor(kCount);
  for (auto it = requests.rbegin(); it != requests.rend(); ++it) {
    server.connection(0)->sendReply(it->message, tn::Value(tn::Dictionary{{"answer", it->message.body["n"]}}));
  }
  for (const auto& [n, reply] : replies.waitFor(kCount)) {
    ASSERT_TRUE(reply.ok());
    EXPECT_EQ((*reply)["answer"], tn::Value(n));
  }
  EXPECT_EQ(client.connection->pendingReplyCount(), 0u);
}

TEST_F(ConnectionTest, RequestsArriveInOrderWithIncreasingIds) {
  Server server("ordered", nullptr);
  Client client("ordered");
  constexpr uint64_t kCount = 2000;
  for (uint64_t n = 0; n < kCount; ++n) ASSERT_TRUE(client.connection->send(numbered(n)));
  const auto events = server.events(0).waitFor(kCount);
  for (uint64_t n = 0; n < kCount; ++n) {
    ASSERT_EQ(events[n].message.body["n"], tn::Value(n));
    if (n > 0) {
      ASSERT_GT(events[n].message.id, events[n - 1].message.id);
    }
  }
}

TEST_F(ConnectionTest, BothSidesKnowThePeerProcess) {
  Server server("identity", Server::echo);
  Client client("identity");
  char self[4096];
  const ssize_t length = ::readlink("/proc/self/exe", self, sizeof self);
  for (const auto& connection : {server.connection(0), client.connection}) {
    const AuditToken token = connection->auditToken();
    EXPECT_EQ(connection->pid(), ::getpid());
    EXPECT_EQ(token.uid, ::getuid());
    EXPECT_EQ(token.gid, ::getgid());
    EXPECT_EQ(token.startTime, processStartTime(::getpid()));
    EXPECT_EQ(connection->executablePath(), std::string(self, static_cast<std::size_t>(length)));
  }
  EXPECT_EQ(server.connection(0)->description(),
            "<relay connection pid=" + std::to_string(::getpid()) + " service=identity>");
}

TEST_F(ConnectionTest, PeerGoingAwayInvalidatesOnceAndFailsEveryPendingReply) {
  Server server("pending", nullptr);
  Client client("pending");
  const auto accepted = server.connection(0);
  constexpr std::size_t kCount = 10;  // the server asks; the client never answers
  Recorder<Reply> failures;
  for (std::size_t i = 0; i < kCount; ++i) {
    accepted->sendWithReply(numbered(i), SerialQueue::create("q"), [&](Reply reply) { failures.add(reply); });
  }
  client.events.waitFor(kCount);
  client.connection->cancel();
  for (const Reply& reply : failures.waitFor(kCount)) EXPECT_TRUE(failedWith(reply, RelayErrorCode::ConnectionInvalid));
  ASSERT_TRUE(server.events(0).waitForKind(Event::Kind::ConnectionInvalid));
  accepted->eventQueue()->sync([] {});  // everything that was going to be delivered is
  EXPECT_EQ(server.events(0).count(Event::Kind::ConnectionInvalid), 1);
  EXPECT_EQ(server.events(0).kinds().back(), Event::Kind::ConnectionInvalid);
  accepted->sendWithReply(numbered(99), SerialQueue::create("q"), [&](Reply reply) { failures.add(reply); });
  EXPECT_TRUE(failedWith(failures.waitFor(kCount + 1).back(), RelayErrorCode::ConnectionInvalid));
  EXPECT_FALSE(accepted->send(numbered(100)));
}

TEST_F(ConnectionTest, ClientIsInterruptedWhenItsServiceGoesAndReconnectsOnTheNextSend) {
  std::optional<Client> client;
  Recorder<Reply> pending;
  {
    Server first("restarting", nullptr);
    client.emplace("restarting");
    client->connection->sendWithReply(numbered(1), SerialQueue::create("q"), [&](Reply reply) { pending.add(reply); });
    first.events(0).waitFor(1);  // it arrived, and is never answered
  }  // the service goes away
  ASSERT_TRUE(client->events.waitForKind(Event::Kind::ConnectionInterrupted));
  EXPECT_TRUE(failedWith(pending.waitFor(1).at(0), RelayErrorCode::ConnectionInterrupted));
  EXPECT_TRUE(failedWith(client->request(numbered(2)), RelayErrorCode::ConnectionInterrupted));
  Server second("restarting", Server::echo);
  const Reply reply = client->request(numbered(3));
  ASSERT_TRUE(reply.ok()) << reply.error().description();
  EXPECT_EQ((*reply)["echo"]["n"], tn::Value(3));
  EXPECT_EQ(client->events.count(Event::Kind::ConnectionInvalid), 0);
  client->connection->cancel();
  EXPECT_TRUE(failedWith(client->request(numbered(4)), RelayErrorCode::ConnectionInvalid));
}

TEST_F(ConnectionTest, NothingIsDeliveredBeforeResumeAndEverythingAfter) {
  Recorder<std::shared_ptr<Connection>> accepted;
  auto listener = Listener::create("held", SerialQueue::create("listener"));
  (*listener)->setNewConnectionHandler([&](std::shared_ptr<Connection> c) { accepted.add(c); });
  (*listener)->resume();
  {
    Client client("held");
    client.connection->send(numbered(1));
    client.connection->send(numbered(2));
  }  // cancelled: the socket closes behind the two requests
  const auto connection = accepted.waitFor(1).at(0);
  test::EventRecorder events;
  connection->setEventHandler(events.handler());
  EXPECT_EQ(events.size(), 0u);
  connection->resume();
  ASSERT_TRUE(events.waitForKind(Event::Kind::ConnectionInvalid));
  const auto kinds = events.kinds();
  EXPECT_EQ(kinds, (std::vector{Event::Kind::Message, Event::Kind::Message, Event::Kind::ConnectionInvalid}));
}

TEST_F(ConnectionTest, ContextIsFinalizedOnTheEventQueueWhenTheConnectionIsFreed) {
  Server server("context", nullptr);
  std::weak_ptr<void> context;
  Recorder<bool> finalizedOnQueue;
  {
    Client client("context");
    const auto held = std::make_shared<int>(42);
    context = held;
    client.connection->setContext(held);
    client.connection->setFinalizer([&, queue = client.connection->eventQueue()](const std::shared_ptr<void>& c) {
      finalizedOnQueue.add(queue->isCurrent() && c == context.lock());
    });
  }  // cancelled; freed once its ConnectionInvalid was handled
  EXPECT_EQ(finalizedOnQueue.waitFor(1), std::vector{true});
  EXPECT_TRUE(test::eventually([&] { return context.expired(); }));
}

TEST_F(ConnectionTest, RefusedRequestsLeaveTheConnectionWorking) {
  Server server("refusals", Server::echo);
  Client client("refusals");
  EXPECT_TRUE(failedWith(client.request(tn::Value(tn::Array{1})), RelayErrorCode::NotAMessage));
  EXPECT_TRUE(failedWith(client.request(tn::Value(tn::Dictionary{{"blob", tn::Bytes(kMaxBodySize)}})),
                         RelayErrorCode::MessageTooLarge));
  EXPECT_FALSE(client.connection->send(tn::Value("text")));
  EXPECT_TRUE(client.request(numbered(1)).ok());
}

TEST_F(ConnectionTest, LargeMessagesCrossInBothDirections) {
  Server server("large", Server::echo);
  Client client("large");
  tn::Bytes blob(8 * 1024 * 1024);
  for (std::size_t i = 0; i < blob.size(); ++i) blob[i] = static_cast<uint8_t>(i * 31);
  const Reply reply = client.request(tn::Value(tn::Dictionary{{"blob", blob}}));
  ASSERT_TRUE(reply.ok());
  EXPECT_TRUE(*(*reply)["echo"]["blob"].data() == blob);
}

}  // namespace
}  // namespace relay
