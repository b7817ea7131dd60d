#include "platform/relay/Listener.h"

#include <gtest/gtest.h>

#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>

#include <fstream>
#include <optional>

#include "platform/relay/RelayError.h"
#include "platform/relay/ServicePath.h"
#include "tests/platform/relay/RelayTestSupport.h"

namespace relay {
namespace {

using test::Client;
using test::numbered;
using test::pathOf;
using test::RawClient;
using test::Server;
using tn::dispatch::SerialQueue;

unsigned modeOf(const std::string& path) {
  struct stat status {};
  return ::stat(path.c_str(), &status) == 0 ? status.st_mode & 07777 : 0;
}

bool isSocket(const std::string& path) {
  struct stat status {};
  return ::lstat(path.c_str(), &status) == 0 && S_ISSOCK(status.st_mode);
}

class ListenerTest : public test::RelayTest {
 protected:
  std::shared_ptr<SerialQueue> queue_ = SerialQueue::create("listener-test");
};

TEST_F(ListenerTest, SuspendedListenerLetsNobodyConnectUntilResumed) {
  auto listener = Listener::create("suspended", queue_);
  ASSERT_TRUE(listener.ok());
  test::Recorder<std::shared_ptr<Connection>> accepted;
  (*listener)->setNewConnectionHandler([&](std::shared_ptr<Connection> c) { accepted.add(c); });
  const auto early = Connection::connectToService("suspended", SerialQueue::create("client"));
  ASSERT_FALSE(early.ok());
  EXPECT_TRUE(isRelayError(early.error(), RelayErrorCode::ServiceUnavailable));
  EXPECT_FALSE(RawClient(pathOf("suspended")).connected());
  (*listener)->resume();
  EXPECT_TRUE(RawClient(pathOf("suspended")).connected());
  accepted.waitFor(1);
  queue_->sync([] {});
  EXPECT_EQ(accepted.size(), 1u) << "a refused early client was accepted after all";
}

TEST_F(ListenerTest, SocketIsOpenToEveryoneInADirectoryOthersMayOnlyRead) {
  const mode_t umask = ::umask(077);  // the modes must not depend on the umask
  auto listener = Listener::create("modes", queue_);
  ::umask(umask);
  ASSERT_TRUE(listener.ok());
  EXPECT_EQ((*listener)->socketPath(), root_.path() + "/run/tenon/relay/modes");
  EXPECT_TRUE(isSocket((*listener)->socketPath()));
  EXPECT_EQ(modeOf((*listener)->socketPath()), 0666u);
  for (const char* directory : {"/run", "/run/tenon", "/run/tenon/relay"}) {
    EXPECT_EQ(modeOf(root_.path() + directory), 0755u) << directory;
  }
}

TEST_F(ListenerTest, ReplacesAStaleSocketButNotALiveOneOrAnotherFile) {
  ASSERT_TRUE(createDirectories(relayDirectory(), 0755).ok());
  {  // a socket file nobody listens on, as a process that died leaves it
    const UniqueFd dead(::socket(AF_UNIX, SOCK_STREAM, 0));
    sockaddr_un address{AF_UNIX, {}};
    pathOf("stale").copy(address.sun_path, sizeof address.sun_path - 1);
    ASSERT_EQ(::bind(dead.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
  }
  Server server("stale", Server::echo);
  EXPECT_TRUE(Client("stale").request(numbered(1)).ok());

  const auto second = Listener::create("stale", queue_);
  ASSERT_FALSE(second.ok());
  EXPECT_NE(second.error().description().find("already serves"), std::string::npos);
  EXPECT_TRUE(Client("stale").request(numbered(2)).ok()) << "the live listener lost its socket";

  std::ofstream(pathOf("file")) << "precious";
  EXPECT_FALSE(Listener::create("file", queue_).ok());
  std::string content;
  std::ifstream(pathOf("file")) >> content;
  EXPECT_EQ(content, "precious");
}

TEST_F(ListenerTest, CancelFreesTheNameButKeepsEstablishedConnections) {
  std::optional<Server> server;
  server.emplace("cancelled", Server::echo);
  Client client("cancelled");
  ASSERT_TRUE(client.request(numbered(1)).ok());
  server->listener().cancel();
  EXPECT_FALSE(isSocket(pathOf("cancelled")));
  EXPECT_FALSE(RawClient(pathOf("cancelled")).connected());
  EXPECT_TRUE(client.request(numbered(2)).ok());
  Server again("cancelled", Server::echo);
  EXPECT_TRUE(Client("cancelled").request(numbered(3)).ok());
  server.reset();
  {
    auto dropped = Listener::create("dropped", queue_);
    (*dropped)->resume();
  }
  EXPECT_FALSE(isSocket(pathOf("dropped"))) << "destroying a listener cancels it";
}

TEST_F(ListenerTest, EachUserHoldsAtMostTheConfiguredNumberOfConnections) {
  Server server("limited", Server::echo);
  server.listener().setMaxConnectionsPerUser(2);
  std::optional<Client> first;
  first.emplace("limited");
  Client second("limited");
  ASSERT_TRUE(first->request(numbered(1)).ok() && second.request(numbered(2)).ok());
  {
    Client third("limited");
    EXPECT_TRUE(third.events.waitForKind(Event::Kind::ConnectionInterrupted)) << "the third was not closed";
  }
  EXPECT_EQ(server.connectionCount(), 2u);
  first.reset();
  ASSERT_TRUE(server.events(0).waitForKind(Event::Kind::ConnectionInvalid));
  EXPECT_TRUE(Client("limited").request(numbered(4)).ok()) << "a closed connection still counts";
}

TEST_F(ListenerTest, RefusesServiceNamesThatAreNotPlainFileNames) {
  for (const std::string& name : {std::string(), std::string("."), std::string(".."), std::string("a/b"),
                                  std::string("nul\0x", 5), std::string(200, 'x')}) {
    const auto listener = Listener::create(name, queue_);
    EXPECT_TRUE(!listener.ok() && isRelayError(listener.error(), RelayErrorCode::InvalidServiceName)) << name;
  }
}

}  // namespace
}  // namespace relay
