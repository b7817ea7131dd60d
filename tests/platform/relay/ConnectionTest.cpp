#include "platform/relay/Connection.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <memory>
#include <string>
#include <vector>

#include "platform/dispatch/Semaphore.h"
#include "platform/dispatch/SerialQueue.h"
#include "platform/relay/ProcessStartTime.h"
#include "platform/relay/RelayError.h"
#include "tests/platform/relay/RelayTestSupport.h"

namespace relay {
namespace {

using test::Client;
using test::Recorder;
using test::RelayTest;
using test::Server;
using tn::dispatch::SerialQueue;

tn::Value numbered(uint64_t n) { return tn::Value(tn::Dictionary{{"n", n}}); }

std::string selfExecutable() {
  char buffer[4096];
  const ssize_t n = ::readlink("/proc/self/exe", buffer, sizeof buffer);
  return n > 0 ? std::string(buffer, static_cast<std::size_t>(n)) : std::string();
}

class ConnectionTest : public RelayTest {};

TEST_F(ConnectionTest, RequestGetsItsReplyOnTheQueueTheSenderNamed) {
  Server server("echo", Server::echo);
  Client client("echo");
  const auto replyQueue = SerialQueue::create("named-reply-queue");
  Recorder<std::pair<Reply, bool>> replies;
  client.connection->sendWithReply(numbered(7), replyQueue, [&](Reply reply) {
    replies.add({std::move(reply), replyQueue->isCurrent()});
  });
  const auto got = replies.waitFor(1);
  ASSERT_EQ(got.size(), 1u);
  ASSERT_TRUE(got[0].first.ok()) << got[0].first.error().description();
  EXPECT_EQ((*got[0].first)["echo"]["n"], tn::Value(7));
  EXPECT_TRUE(got[0].second) << "reply handler ran off the named queue";
}

TEST_F(ConnectionTest, RepliesAnsweredOutOfOrderReachTheirOwnRequests) {
  // The server answers nothing at first; the test answers in reverse order.
  Server server("reverse", [](const Message&) { return tn::Value(); });
  Client client("reverse");
  constexpr uint64_t kCount = 20;
  Recorder<std::pair<uint64_t, Reply>> replies;
  const auto replyQueue = SerialQueue::create("replies");
  for (uint64_t n = 0; n < kCount; ++n) {
    client.connection->sendWithReply(numbered(n), replyQueue,
                                     [&replies, n](Reply reply) { replies.add({n, std::move(reply)}); });
  }
  const auto requests = server.events(0).waitFor(kCount);
  ASSERT_EQ(requests.size(), kCount);
  for (auto it = requests.rbegin(); it != requests.rend(); ++it) {
    ASSERT_EQ(it->kind, Event::Kind::Message);
    EXPECT_TRUE(server.connection(0)->sendReply(it->message, tn::Value(tn::Dictionary{{"answer", it->message.body["n"]}})));
  }
  const auto got = replies.waitFor(kCount);
  ASSERT_EQ(got.size(), kCount);
  for (const auto& [n, reply] : got) {
    ASSERT_TRUE(reply.ok());
    EXPECT_EQ((*reply)["answer"], tn::Value(n));
  }
  EXPECT_EQ(got.front().first, kCount - 1) << "replies are handled in the order they arrive";
  EXPECT_EQ(client.connection->pendingReplyCount(), 0u);
}

TEST_F(ConnectionTest, RequestsOfOneConnectionArriveInOrderOnItsEventQueue) {
  Server server("ordered", nullptr);
  Client client("ordered");
  constexpr uint64_t kCount = 2000;
  for (uint64_t n = 0; n < kCount; ++n) ASSERT_TRUE(client.connection->send(numbered(n)));
  const auto events = server.events(0).waitFor(kCount);
  ASSERT_EQ(events.size(), kCount);
  for (uint64_t n = 0; n < kCount; ++n) {
    ASSERT_EQ(events[n].kind, Event::Kind::Message);
    ASSERT_EQ(events[n].message.body["n"], tn::Value(n)) << "at " << n;
  }
  // Ids are the sender's, strictly increasing.
  EXPECT_TRUE(std::is_sorted(events.begin(), events.end(),
                             [](const Event& a, const Event& b) { return a.message.id <= b.message.id; }));
}

TEST_F(ConnectionTest, EventHandlerRunsOnTheConnectionsOwnQueue) {
  std::atomic<bool> onQueue{false};
  Server server("queue-check", nullptr);
  Client client("queue-check");
  const auto connection = server.connection(0);
  ASSERT_TRUE(client.connection->send(numbered(1)));
  ASSERT_EQ(server.events(0).waitFor(1).size(), 1u);
  connection->eventQueue()->sync([&] { onQueue = true; });
  EXPECT_TRUE(onQueue);
  EXPECT_NE(connection->eventQueue(), client.connection->eventQueue());
}

TEST_F(ConnectionTest, BothSidesKnowThePeerProcess) {
  Server server("identity", Server::echo);
  Client client("identity");
  const auto accepted = server.connection(0);
  for (const auto& connection : {accepted, client.connection}) {
    const AuditToken token = connection->auditToken();
    EXPECT_EQ(token.pid, ::getpid());
    EXPECT_EQ(connection->pid(), ::getpid());
    EXPECT_EQ(token.uid, ::getuid());
    EXPECT_EQ(token.gid, ::getgid());
    EXPECT_EQ(token.startTime, processStartTime(::getpid()).value_or(0));
    EXPECT_TRUE(token.stillSameProcess());
    EXPECT_EQ(connection->executablePath(), selfExecutable());
  }
  EXPECT_TRUE(accepted->isServerSide());
  EXPECT_FALSE(client.connection->isServerSide());
  EXPECT_EQ(accepted->description(), "<relay connection pid=" + std::to_string(::getpid()) + " service=identity>");
}

TEST_F(ConnectionTest, PeerGoingAwayInvalidatesOnceAndFailsEveryPendingReply) {
  Server server("pending", nullptr);
  Client client("pending");
  const auto accepted = server.connection(0);
  // The server asks the client; the client never answers.
  constexpr int kCount = 10;
  Recorder<Reply> failures;
  for (int i = 0; i < kCount; ++i) {
    accepted->sendWithReply(numbered(static_cast<uint64_t>(i)), SerialQueue::create("pending-replies"),
                            [&](Reply reply) { failures.add(std::move(reply)); });
  }
  ASSERT_EQ(client.events.waitFor(kCount).size(), static_cast<std::size_t>(kCount));
  client.connection->cancel();
  ASSERT_TRUE(server.events(0).waitForKind(Event::Kind::ConnectionInvalid));
  const auto got = failures.waitFor(kCount);
  ASSERT_EQ(got.size(), static_cast<std::size_t>(kCount));
  for (const Reply& reply : got) {
    ASSERT_FALSE(reply.ok());
    EXPECT_TRUE(isRelayError(reply.error(), RelayErrorCode::ConnectionInvalid)) << reply.error().description();
  }
  // Nothing follows ConnectionInvalid, and it came once: a last round trip
  // through the queue shows every event that was going to be delivered.
  accepted->eventQueue()->sync([] {});
  const auto kinds = server.events(0).kinds();
  EXPECT_EQ(std::count(kinds.begin(), kinds.end(), Event::Kind::ConnectionInvalid), 1);
  EXPECT_EQ(kinds.back(), Event::Kind::ConnectionInvalid);
  // Sending on an invalid connection fails at once, on the reply queue.
  Recorder<Reply> late;
  accepted->sendWithReply(numbered(99), SerialQueue::create("late"), [&](Reply reply) { late.add(std::move(reply)); });
  ASSERT_EQ(late.waitFor(1).size(), 1u);
  EXPECT_TRUE(isRelayError(late.snapshot()[0].error(), RelayErrorCode::ConnectionInvalid));
  EXPECT_FALSE(accepted->send(numbered(100)));
  EXPECT_FALSE(failures.size() > static_cast<std::size_t>(kCount)) << "a handler ran twice";
}

TEST_F(ConnectionTest, ClientIsInterruptedWhenTheServiceGoesAndReconnectsOnTheNextSend) {
  Client* clientPointer = nullptr;
  std::optional<Client> client;
  {
    Server first("restarting", Server::echo);
    client.emplace("restarting");
    clientPointer = &*client;
    ASSERT_TRUE(clientPointer->request(numbered(1)).ok());
    // A request the first server never answers fails with the interruption.
    Recorder<Reply> pending;
    first.connection(0);
    client->connection->sendWithReply(tn::Value(tn::Dictionary{}), SerialQueue::create("pending"),
                                      [&](Reply reply) { pending.add(std::move(reply)); });
    first.connection(0)->cancel();
    ASSERT_TRUE(client->events.waitForKind(Event::Kind::ConnectionInterrupted));
    const auto failed = pending.waitFor(1);
    ASSERT_EQ(failed.size(), 1u);
    if (!failed[0].ok()) {
      EXPECT_TRUE(isRelayError(failed[0].error(), RelayErrorCode::ConnectionInterrupted)) << failed[0].error().description();
    }
  }
  // No service now: sends fail as interrupted, the connection stays usable.
  const Reply unreachable = client->request(numbered(2));
  ASSERT_FALSE(unreachable.ok());
  EXPECT_TRUE(isRelayError(unreachable.error(), RelayErrorCode::ConnectionInterrupted));

  Server second("restarting", Server::echo);
  const Reply reply = client->request(numbered(3));
  ASSERT_TRUE(reply.ok()) << reply.error().description();
  EXPECT_EQ((*reply)["echo"]["n"], tn::Value(3));
  EXPECT_EQ(second.connectionCount(), 1u);
  const auto kinds = client->events.kinds();
  EXPECT_EQ(std::count(kinds.begin(), kinds.end(), Event::Kind::ConnectionInvalid), 0);
  client.reset();
}

TEST_F(ConnectionTest, CancelledClientIsInvalidAndStaysSo) {
  Server server("cancel", Server::echo);
  Client client("cancel");
  client.connection->cancel();
  ASSERT_TRUE(client.events.waitForKind(Event::Kind::ConnectionInvalid));
  const Reply reply = client.request(numbered(1));
  ASSERT_FALSE(reply.ok());
  EXPECT_TRUE(isRelayError(reply.error(), RelayErrorCode::ConnectionInvalid));
  EXPECT_TRUE(server.events(0).waitForKind(Event::Kind::ConnectionInvalid));
}

TEST_F(ConnectionTest, NothingIsDeliveredBeforeResumeAndEverythingAfter) {
  const auto listenerQueue = SerialQueue::create("held");
  auto listener = Listener::create("held", listenerQueue);
  ASSERT_TRUE(listener.ok());
  Recorder<std::shared_ptr<Connection>> accepted;
  (*listener)->setNewConnectionHandler([&](std::shared_ptr<Connection> c) { accepted.add(std::move(c)); });
  (*listener)->resume();
  {
    Client client("held");
    ASSERT_TRUE(client.connection->send(numbered(1)));
    ASSERT_TRUE(client.connection->send(numbered(2)));
  }  // the client cancels: its socket closes
  const auto connection = accepted.waitFor(1).at(0);
  test::EventRecorder events;
  connection->setEventHandler(events.handler());
  EXPECT_EQ(events.size(), 0u);
  connection->resume();
  ASSERT_TRUE(events.waitForKind(Event::Kind::ConnectionInvalid));
  const auto kinds = events.kinds();
  ASSERT_EQ(kinds.size(), 3u);
  EXPECT_EQ(kinds[0], Event::Kind::Message);
  EXPECT_EQ(kinds[1], Event::Kind::Message);
  EXPECT_EQ(events.snapshot()[1].message.body["n"], tn::Value(2));
}

TEST_F(ConnectionTest, ContextIsFinalizedOnTheEventQueueWhenTheConnectionIsFreed) {
  Server server("context", nullptr);
  std::weak_ptr<void> contextAlive;
  Recorder<bool> finalized;  // whether the finalizer ran on the event queue
  {
    Client client("context");
    auto context = std::make_shared<int>(42);
    contextAlive = context;
    client.connection->setContext(context);
    EXPECT_EQ(client.connection->context(), context);
    const auto queue = client.connection->eventQueue();
    client.connection->setFinalizer([&finalized, queue](const std::shared_ptr<void>& held) {
      finalized.add(queue->isCurrent() && *static_cast<int*>(held.get()) == 42);
    });
  }  // cancelled; its last reference goes once ConnectionInvalid was handled
  const auto got = finalized.waitFor(1);
  ASSERT_EQ(got.size(), 1u);
  EXPECT_TRUE(got[0]);
  EXPECT_TRUE(test::eventually([&] { return contextAlive.expired(); }));
}

TEST_F(ConnectionTest, LocalRefusalsDoNotHurtTheConnection) {
  Server server("refusals", Server::echo);
  Client client("refusals");
  const Reply notAMap = client.request(tn::Value(tn::Array{1, 2}));
  ASSERT_FALSE(notAMap.ok());
  EXPECT_TRUE(isRelayError(notAMap.error(), RelayErrorCode::NotAMessage));
  const Reply tooLarge = client.request(tn::Value(tn::Dictionary{{"blob", tn::Bytes(kMaxBodySize, 0)}}));
  ASSERT_FALSE(tooLarge.ok());
  EXPECT_TRUE(isRelayError(tooLarge.error(), RelayErrorCode::MessageTooLarge));
  EXPECT_FALSE(client.connection->send(tn::Value("text")));
  EXPECT_TRUE(client.request(numbered(1)).ok());
}

TEST_F(ConnectionTest, LargeMessagesCrossInBothDirections) {
  Server server("large", Server::echo);
  Client client("large");
  tn::Bytes blob(8 * 1024 * 1024);
  for (std::size_t i = 0; i < blob.size(); ++i) blob[i] = static_cast<uint8_t>(i * 31);
  const Reply reply = client.request(tn::Value(tn::Dictionary{{"blob", blob}}));
  ASSERT_TRUE(reply.ok()) << reply.error().description();
  const tn::Bytes* echoed = (*reply)["echo"]["blob"].data();
  ASSERT_NE(echoed, nullptr);
  EXPECT_TRUE(*echoed == blob);
}

TEST_F(ConnectionTest, ConnectingToAMissingServiceFails) {
  tn::Result<std::shared_ptr<Connection>> missing = Connection::connectToService("absent", SerialQueue::create("q"));
  ASSERT_FALSE(missing.ok());
  EXPECT_TRUE(isRelayError(missing.error(), RelayErrorCode::ServiceUnavailable));
  tn::Result<std::shared_ptr<Connection>> invalid = Connection::connectToService("a/b", SerialQueue::create("q"));
  ASSERT_FALSE(invalid.ok());
  EXPECT_TRUE(isRelayError(invalid.error(), RelayErrorCode::InvalidServiceName));
}

}  // namespace
}  // namespace relay
