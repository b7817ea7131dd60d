// TNDServer, TNDRelayClient and Transaction in one process: a real server on
// a private TENON_ROOT, real relay connections from this process to it, and
// from child processes that run a trusted program installed in the root
// (the build directory's modes depend on the umask, so the test program
// itself is never what a document names).

#include <gtest/gtest.h>

#include <fcntl.h>
#include <grp.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <future>
#include <thread>

#include "platform/dispatch/Semaphore.h"
#include "platform/log/Log.h"
#include "platform/notify/Post.h"
#include "platform/relay/Connection.h"
#include "platform/relay/Listener.h"
#include "tenond/requests/Transaction.h"
#include "tenond/server/TNDPlugInHold.h"
#include "tenond/server/TNDRelayClient.h"
#include "tenond/server/TNDServer.h"
#include "tests/support/TrustedInstall.h"

namespace tnd {
namespace {

namespace fs = std::filesystem;
using tn::Dictionary;
using tn::Value;

// One server per process (the daemon has exactly one); every test shares it.
class Server : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    root_ = fs::temp_directory_path() / ("tenond-server-test-" + std::to_string(getpid()));
    tn::test::makeDirectory(root_);
    setenv("TENON_ROOT", root_.c_str(), 1);
    grantThePeerProgram();
    // Members of group 4242 are privileged users.
    tn::test::writeFile(root_ / "etc/tenon/tenond.manifest", R"({"privileged-groups": [4242]})");
    tn::log::configure("debug");
    server_ = TNDServer::initForService("server.test", std::nullopt);
    ASSERT_TRUE(server_);
    server_->service()->resume();
  }
  static void TearDownTestSuite() { fs::remove_all(root_); }

  // A trusted copy of the test client program is the entitled peer; a
  // root-owned document in entitlements.d grants it a few entitlements of
  // every shape and the manager entitlement.
  static void grantThePeerProgram() {
    tn::test::installFile(std::string(TENON_BINARY_DIR "/tests/e2e/exec_after_connect"), root_.string(),
                          "usr/bin/peer");
    tn::test::writeFile(root_ / "etc/tenon/entitlements.d/server-test.manifest",
                        R"({"executable": ")" + peerProgram() +
                            R"(", "entitlements": {"com.test.yes": true, "com.test.zero": 0,)"
                            R"( "com.test.no": false, "com.test.text": "x", "com.test.list": [1],)"
                            R"( "com.ostrel.private.tenon.manager": true}})");
  }
  static std::string peerProgram() { return (root_ / "usr/bin/peer").string(); }

  // A connection from this process, and the daemon's client object for it.
  struct Pair {
    std::shared_ptr<relay::Connection> peer;
    std::shared_ptr<TNDRelayClient> client;
  };
  Pair connect() {
    Pair pair;
    pair.client = accept([&](const std::string& service) {
      auto peer = relay::Connection::connectToService(service, replies_);
      EXPECT_TRUE(peer);
      (*peer)->setEventHandler([](const relay::Event&) {});
      (*peer)->resume();
      pair.peer = *peer;
    });
    // Answered only once the client's identity is complete.
    EXPECT_EQ(request(pair, {{"version", 1u}})["errorcode"], Value(7u));
    return pair;
  }

  // The client object for the connection that connectPeer(service) makes.
  // A listener of the test's own hands the connection to the real client
  // set-up, so that the test holds the client object.
  template <typename ConnectPeer>
  std::shared_ptr<TNDRelayClient> accept(ConnectPeer connectPeer) {
    static int serial = 0;
    const std::string service = "server.test.pair" + std::to_string(serial++);
    auto listener = relay::Listener::create(service, tn::dispatch::SerialQueue::create("pair"));
    EXPECT_TRUE(listener);
    std::promise<std::shared_ptr<TNDRelayClient>> made;
    (*listener)->setNewConnectionHandler([&](std::shared_ptr<relay::Connection> c) {
      made.set_value(TNDRelayClient::initWithConnection(std::move(c), server_));
    });
    (*listener)->resume();
    connectPeer(service);
    std::shared_ptr<TNDRelayClient> client = made.get_future().get();
    (*listener)->cancel();
    return client;
  }

  // A child process running the trusted peer program as uid (and gid) `uid`
  // with the supplementary `groups`, connected until the object goes.
  struct ChildPeer {
    pid_t pid = -1;
    int release = -1;
    std::shared_ptr<TNDRelayClient> client;
    ~ChildPeer() {
      ::close(release);
      int status = 0;
      if (pid > 0) ::waitpid(pid, &status, 0);
    }
  };
  std::unique_ptr<ChildPeer> connectChild(uid_t uid, std::vector<gid_t> groups = {}) {
    auto child = std::make_unique<ChildPeer>();
    tn::log::ScopedCaptureSink capture;
    child->client = accept([&](const std::string& service) {
      int release[2];
      EXPECT_EQ(::pipe2(release, O_CLOEXEC), 0);
      const std::string program = peerProgram();
      child->pid = ::fork();
      if (child->pid == 0) {
        ::dup2(release[0], STDIN_FILENO);
        if (::setgroups(groups.size(), groups.data()) != 0 || ::setgid(uid) != 0 || ::setuid(uid) != 0) ::_exit(9);
        ::execl(program.c_str(), program.c_str(), "--service", service.c_str(), "--wait", nullptr);
        ::_exit(8);
      }
      ::close(release[0]);
      child->release = release[1];
    });
    const std::string identified = "client " + std::to_string(child->pid) + " identified";
    EXPECT_TRUE(eventually([&] { return capture->contains("ops", tn::log::Level::Debug, identified); }));
    return child;
  }

  // The reply to `body`, or null after half a second of silence.
  Value request(const Pair& pair, Dictionary body, std::chrono::milliseconds wait = std::chrono::seconds(5)) {
    tn::dispatch::Semaphore done;
    auto reply = std::make_shared<Value>();
    pair.peer->sendWithReply(Value(std::move(body)), replies_, [reply, &done](relay::Reply r) {
      if (r) *reply = *r;
      done.signal();
    });
    if (!done.waitFor(wait)) return Value();
    return *reply;
  }

  static uint64_t annotationChanges() { return *notify::postCount(TNDatabase::kAnnotationChangeNotification); }

  template <typename Condition>
  static bool eventually(Condition condition) {
    for (int i = 0; i < 500; ++i) {
      if (condition()) return true;
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return false;
  }

  static inline fs::path root_;
  static inline std::shared_ptr<TNDServer> server_;
  std::shared_ptr<tn::dispatch::SerialQueue> replies_ = tn::dispatch::SerialQueue::create("replies");
};

TEST_F(Server, IsTheProcessServerWithItsQueues) {
  EXPECT_EQ(TNDServer::server(), server_);
  EXPECT_EQ(server_->mainQueue()->label(), "service");
  EXPECT_EQ(server_->mainQueue()->qualityOfService(), 25);
  EXPECT_EQ(server_->relayQueue()->label(), "relay");
  EXPECT_EQ(server_->syncQueue()->label(), "serverSync");
  EXPECT_EQ(server_->annotationsPath(), root_.string() + "/var/db/Tenon-Annotations");
}

TEST_F(Server, ClientKnowsItsPeer) {
  Pair pair = connect();
  EXPECT_EQ(pair.client->pid(), getpid());
  EXPECT_EQ(pair.client->path(), fs::read_symlink("/proc/self/exe").string());
  EXPECT_FALSE(pair.client->hasEntitlement("com.test.yes")) << "no document names the test program";
  EXPECT_FALSE(pair.client->isSandboxed());
  EXPECT_EQ(pair.client->isPrivilegedUser(), getuid() == 0 || getuid() == geteuid());
  EXPECT_NE(pair.client->description().find("pid=" + std::to_string(getpid())), std::string::npos);
}

TEST_F(Server, ClientHasTheEntitlementsOfTheProgramItRuns) {
  if (geteuid() != 0) GTEST_SKIP() << "trusted files must be root's";
  const auto child = connectChild(0);
  const std::shared_ptr<TNDRelayClient>& client = child->client;
  EXPECT_EQ(client->pid(), child->pid);
  EXPECT_EQ(client->path(), peerProgram());
  EXPECT_TRUE(client->hasEntitlement("com.test.yes"));
  EXPECT_TRUE(client->hasEntitlement("com.test.text"));
  EXPECT_TRUE(client->hasEntitlement("com.test.list"));
  EXPECT_FALSE(client->hasEntitlement("com.test.no"));
  EXPECT_FALSE(client->hasEntitlement("com.test.zero"));
  EXPECT_FALSE(client->hasEntitlement("com.test.absent"));
  EXPECT_EQ(client->entitlementValueForKey("com.test.text"), Value("x"));
  EXPECT_TRUE(client->mayManage());
}

// The manager entitlement names the program; the user must be privileged
// too: root, the daemon's user, or a member of a configured group.
TEST_F(Server, ManagingNeedsAPrivilegedUserAsWellAsTheEntitlement) {
  if (geteuid() != 0) GTEST_SKIP() << "making clients of another uid needs root";
  EXPECT_EQ(server_->configuration().privilegedGroups, std::vector<gid_t>{4242});
  const auto nobody = connectChild(65534);
  EXPECT_TRUE(nobody->client->hasEntitlement(kManagerEntitlement));
  EXPECT_FALSE(nobody->client->isPrivilegedUser());
  EXPECT_FALSE(nobody->client->mayManage());

  const auto member = connectChild(65534, {4242});
  EXPECT_EQ(member->client->peerIdentity().auditToken.groups, std::vector<gid_t>{4242});
  EXPECT_TRUE(member->client->isPrivilegedUser());
  EXPECT_TRUE(member->client->mayManage());
}

TEST_F(Server, ADeadClientLosesEveryHoldWithOneLineAndOneNotificationEach) {
  tn::log::ScopedCaptureSink capture;
  Pair pair = connect();
  Pair other = connect();
  server_->addHold(std::make_shared<TNDPlugInHold>(std::vector<tn::UUID>{tn::UUID::random()}, pair.client));
  server_->addHold(std::make_shared<TNDPlugInHold>(std::vector<tn::UUID>{tn::UUID::random()}, pair.client));
  auto kept = std::make_shared<TNDPlugInHold>(std::vector<tn::UUID>{tn::UUID::random()}, other.client);
  server_->addHold(kept);
  const uint64_t before = annotationChanges();

  pair.peer->cancel();
  ASSERT_TRUE(eventually([&] { return !pair.client->acceptWork(); }));
  EXPECT_EQ(server_->holdCount(), 1u);
  EXPECT_EQ(capture->count("ops", tn::log::Level::Debug, "for dead client pid " + std::to_string(getpid())), 2u);
  EXPECT_EQ(annotationChanges(), before + 2);
  EXPECT_TRUE(capture->contains("ops", tn::log::Level::Debug, "is dead"));

  server_->unholdToken(kept->uuid());
  EXPECT_EQ(server_->holdCount(), 0u);
  EXPECT_EQ(annotationChanges(), before + 3);
  server_->unholdToken(kept->uuid());  // an unknown token changes nothing
  EXPECT_EQ(annotationChanges(), before + 3);
}

TEST_F(Server, HoldsBlockTheirPlugInsForTheUsersTheyReachUntilReleased) {
  Pair pair = connect();
  const tn::UUID held = tn::UUID::random(), free = tn::UUID::random();
  auto everyone = std::make_shared<TNDPlugInHold>(std::vector<tn::UUID>{held, held}, pair.client);
  EXPECT_EQ(everyone->blockedCount(), 1u);
  ASSERT_TRUE(server_->addHold(everyone));
  EXPECT_TRUE(server_->holdOnPlugIn(held, 1000));
  EXPECT_TRUE(server_->holdOnPlugIn(held, 0));
  EXPECT_FALSE(server_->holdOnPlugIn(free, 1000));
  server_->unholdToken(everyone->uuid());
  EXPECT_FALSE(server_->holdOnPlugIn(held, 1000));

  // A user's own hold keeps the plug-in from that user's hosts only.
  auto own = std::make_shared<TNDPlugInHold>(std::vector<tn::UUID>{held}, pair.client, uid_t{1000});
  ASSERT_TRUE(server_->addHold(own));
  EXPECT_TRUE(server_->holdOnPlugIn(held, 1000));
  EXPECT_FALSE(server_->holdOnPlugIn(held, 1001));
  EXPECT_EQ(server_->heldPlugIns(1000), std::unordered_set<tn::UUID>{held});
  EXPECT_TRUE(server_->heldPlugIns(1001).empty());
  server_->unholdToken(own->uuid());
}

TEST_F(Server, AClientKeepsAtMostItsShareOfHolds) {
  Pair pair = connect();
  Pair other = connect();
  const uint64_t before = annotationChanges();
  for (size_t i = 0; i < TNDServer::kHoldsPerClient; ++i)
    ASSERT_TRUE(server_->addHold(std::make_shared<TNDPlugInHold>(std::vector<tn::UUID>{}, pair.client)));
  EXPECT_FALSE(server_->addHold(std::make_shared<TNDPlugInHold>(std::vector<tn::UUID>{}, pair.client)));
  EXPECT_EQ(server_->holdCount(), TNDServer::kHoldsPerClient);
  EXPECT_EQ(annotationChanges(), before + TNDServer::kHoldsPerClient) << "nothing posted for the refused one";
  EXPECT_TRUE(server_->addHold(std::make_shared<TNDPlugInHold>(std::vector<tn::UUID>{}, other.client)));
  pair.peer->cancel();
  other.peer->cancel();
  ASSERT_TRUE(eventually([&] { return server_->holdCount() == 0; }));
}

TEST_F(Server, AClientThatNoLongerAcceptsWorkGetsOnlyItsVersionErrors) {
  Pair pair = connect();
  EXPECT_EQ(request(pair, {{"version", 3u}, {"request", "x"}})["errorcode"], Value(4u));
  pair.client->setAcceptWork(false);
  EXPECT_TRUE(request(pair, {{"version", 3u}, {"request", "x"}}, std::chrono::milliseconds(300)).isNull());
  EXPECT_EQ(request(pair, {{"version", 1u}})["errorcode"], Value(7u));
}

TEST_F(Server, DescriptionSaysWhenTheConnectionIsGone) {
  Pair pair = connect();
  std::weak_ptr<relay::Connection> serverSide = pair.client->connection();
  pair.peer->cancel();
  ASSERT_TRUE(eventually([&] { return serverSide.expired(); }));
  EXPECT_NE(pair.client->description().find("NO CONNECTION"), std::string::npos) << pair.client->description();
}

}  // namespace
}  // namespace tnd
