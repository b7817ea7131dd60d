// Holds end to end: the real tenond, a host process (warden_host) that
// readies and starts real plug-in instances through the supervisor, and
// clients that place and release holds on connections they keep open (a
// hold ends with its connection). Order of events is read from replies and
// the daemon's log, never from sleeps: where a termination must still be
// pending, one instance is stopped (SIGSTOP) with a long grace period
// configured, so it cannot exit until the test kills it.

#include <gtest/gtest.h>
#include <signal.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <future>
#include <memory>
#include <string>
#include <thread>

#include "platform/dispatch/SerialQueue.h"
#include "platform/notify/Post.h"
#include "platform/relay/Connection.h"
#include "tests/e2e/AnnotationTestSupport.h"
#include "tests/e2e/WardenTestSupport.h"
#include "tests/platform/bundle/BundleTestSupport.h"
#include "tests/support/DaemonProcess.h"

namespace {

namespace fs = std::filesystem;
using namespace tn::test::warden_support;
using tn::Array;
using tn::Dictionary;
using tn::Value;
using tn::test::DaemonProcess;

constexpr const char* kTools = "opt/tenon/applications/Tools";
constexpr const char* kKept = "opt/tenon/applications/Kept";
constexpr const char* kChange = "com.ostrel.tenon.annotation-change";
const std::vector<std::string> kToolNames{"A", "B", "C"};

// A plug-in bundle named `name` in the application at `app`: the example
// plug-in's program under the identifier com.example.<lowercase name>, and
// its data container, owned by the user its instances run as.
void makePlugIn(const std::string& root, const fs::path& app, const std::string& name, uid_t hostUid) {
  std::string identifier = "com.example." + name;
  for (char& c : identifier) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  const fs::path bundle = app / "Support/PlugIns" / (name + ".tnx");
  tn::test::makeBundle(bundle.string(), R"({"BNBundleIdentifier": ")" + identifier + R"(", "BNBundleVersion": "1.0",
      "BNBundleExecutable": "upcase", "XTExtension": {"XTExtensionPointIdentifier": "com.example.text-service",
      "XTExtensionAttributes": {}}})");
  install(TENON_BINARY_DIR "/examples/plugins/upcase/upcase", bundle / "bin/upcase", fs::perms(0755));
  const fs::path container = fs::path(root) / "var/lib/tenon/containers" / identifier;
  fs::create_directories(container);
  ASSERT_EQ(::chown(container.c_str(), hostUid, hostUid), 0);
  fs::permissions(container, fs::perms(0700));
}

// Tools holds A, B and C; Kept holds D. Instances get a minute to stop, so
// a stopped one keeps a termination pending until the test kills it.
void prepareHoldRoot(const std::string& root, uid_t hostUid) {
  prepareRoot(root, hostUid);
  const fs::path tools = fs::path(root) / kTools;
  tn::test::makeBundle(tools.string(), R"({"BNBundleIdentifier": "com.example.tools"})");
  for (const std::string& name : kToolNames) makePlugIn(root, tools, name, hostUid);
  const fs::path kept = fs::path(root) / kKept;
  tn::test::makeBundle(kept.string(), R"({"BNBundleIdentifier": "com.example.kept"})");
  makePlugIn(root, kept, "D", hostUid);
  tn::test::writeFile(root + "/etc/tenon/tenond.manifest", R"({"termination-grace-seconds": 60})");
  openDirectories(root);
}

// A client connection kept open: its holds last as long as it does.
class Client {
 public:
  explicit Client(const std::string& service) : queue_(tn::dispatch::SerialQueue::create("test.client")) {
    auto connection = relay::Connection::connectToService(service, queue_);
    if (connection.ok()) {
      connection_ = *connection;
      connection_->setEventHandler([](const relay::Event&) {});
      connection_->resume();
    }
  }
  ~Client() { close(); }

  void close() {
    if (connection_) connection_->cancel();
    connection_.reset();
  }

  // Sends the request (version 3); the reply comes in the future.
  std::future<Value> send(Dictionary request) {
    auto promise = std::make_shared<std::promise<Value>>();
    std::future<Value> reply = promise->get_future();
    if (!connection_) {
      promise->set_value(Dictionary{{"error", "not connected"}});
      return reply;
    }
    request.set("version", 3);
    connection_->sendWithReply(Value(std::move(request)), queue_, [promise](relay::Reply answer) {
      promise->set_value(answer.ok() ? *answer : Value(Dictionary{{"error", answer.error().description()}}));
    });
    return reply;
  }

  // The reply, or {"error": "no reply"} after 30 s.
  Value request(Dictionary request) {
    std::future<Value> reply = send(std::move(request));
    if (reply.wait_for(std::chrono::seconds(30)) != std::future_status::ready) return Dictionary{{"error", "no reply"}};
    return reply.get();
  }

  Value hold(const std::vector<std::string>& paths, uint64_t flags) {
    return request({{"request", "lock"}, {"paths", pathArray(paths)}, {"flags", flags}});
  }
  Value release(const Value& token) { return request({{"request", "lock"}, {"uuids", Array{token}}}); }

  static Value pathArray(const std::vector<std::string>& paths) {
    Array array;
    for (const std::string& path : paths) array.push_back(Value(path));
    return array;
  }

 private:
  std::shared_ptr<tn::dispatch::SerialQueue> queue_;
  std::shared_ptr<relay::Connection> connection_;
};

class Holds : public ::testing::Test {
 protected:
  Holds()
      : hostUid_(::geteuid() == 0 ? kNobody : ::geteuid()),
        daemon_(tn::test::tenondBinaryPath(), {}, [this](const std::string& root) { prepareHoldRoot(root, hostUid_); }) {
    ::setenv("TENON_ROOT", daemon_.root().c_str(), 1);
  }
  ~Holds() override { ::unsetenv("TENON_ROOT"); }

  void SetUp() override {
    ASSERT_TRUE(daemon_.accepting()) << daemon_.log();
    for (const std::string& name : kToolNames) {
      uuids_.push_back(tn::test::registeredUUID(daemon_.root(), plugInPath(kTools, name)));
      ASSERT_FALSE(uuids_.back().isNil()) << name << daemon_.log();
    }
  }

  std::string app(const char* relative) const { return daemon_.root() + "/" + relative; }
  std::string plugInPath(const char* application, const std::string& name) const {
    return app(application) + "/Support/PlugIns/" + name + ".tnx";
  }
  std::string identifier(size_t i) const { return "com.example." + std::string(1, static_cast<char>('a' + i)); }

  // "ready" from the host for tool i: "ready" or "error <code> <message>".
  std::string ready(Host& host, size_t i) { return host.command("ready " + daemon_.service() + " " + uuids_[i].string()); }
  std::string heldRefusal(size_t i) const {
    return "error 11 access to plugin " + identifier(i) + " denied: the plug-in is on hold";
  }

  // Readies and starts tool i for the host; its pid.
  pid_t startTool(Host& host, size_t i) {
    EXPECT_EQ(ready(host, i), "ready") << daemon_.log();
    const pid_t pid = startedPid(host.command("start " + identifier(i)));
    EXPECT_GT(pid, 0) << daemon_.log();
    return pid;
  }

  // Waits (at most 30 s) until the daemon's log holds `text`.
  // Waits (at most 30 s) for a line holding text, at or after `from`.
  bool logged(const std::string& text, size_t from = 0) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
    while (daemon_.log().find(text, from) == std::string::npos) {
      if (std::chrono::steady_clock::now() > deadline) return false;
      std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    return true;
  }
  size_t logPosition(const std::string& text) { return daemon_.log().find(text); }

  static uint64_t notifications() {
    const tn::Result<uint64_t> count = notify::postCount(kChange);
    return count ? *count : 0;
  }
  static bool gone(pid_t pid) { return ::kill(pid, 0) == -1 && errno == ESRCH; }
  // Waits (at most 30 s) until the process's state is "stopped".
  static bool stopped(pid_t pid) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
    while (std::chrono::steady_clock::now() < deadline) {
      std::ifstream stat("/proc/" + std::to_string(pid) + "/stat");
      std::string text((std::istreambuf_iterator<char>(stat)), std::istreambuf_iterator<char>());
      const size_t state = text.rfind(')');
      if (state != std::string::npos && text.size() > state + 2 && text[state + 2] == 'T') return true;
      std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    return false;
  }

  const uid_t hostUid_;
  DaemonProcess daemon_;
  std::vector<tn::UUID> uuids_;
};

TEST_F(Holds, AnApplicationsHoldRefusesEachOfItsPlugInsUntilAnotherClientReleasesIt) {
  Host host(daemon_.root(), hostUid_);
  Client holder(daemon_.service());
  const uint64_t before = notifications();
  const Value held = holder.hold({app(kTools)}, 0);
  ASSERT_TRUE(held["uuids"].uuid()) << held << daemon_.log();
  EXPECT_EQ(notifications(), before + 1);
  for (size_t i = 0; i < kToolNames.size(); ++i) EXPECT_EQ(ready(host, i), heldRefusal(i));
  EXPECT_TRUE(logged("hold request granted uuid:" + held["uuids"].uuid()->string()));

  // An unknown token releases nothing and posts nothing; the token from
  // another client releases the hold.
  Client other(daemon_.service());
  EXPECT_EQ(other.release(Value(tn::UUID::random())), Value(Dictionary{}));
  EXPECT_EQ(notifications(), before + 1);
  EXPECT_EQ(other.release(held["uuids"]), Value(Dictionary{}));
  EXPECT_EQ(notifications(), before + 2);
  EXPECT_TRUE(logged("releasing plug-in hold " + held["uuids"].uuid()->string() + " at client's request"));
  for (size_t i = 0; i < kToolNames.size(); ++i) EXPECT_EQ(ready(host, i), "ready") << daemon_.log();
}

TEST_F(Holds, RefusedHoldRequestsHoldNothing) {
  Host host(daemon_.root(), hostUid_);
  Client holder(daemon_.service());
  const std::string missing = daemon_.root() + "/opt/tenon/applications/Missing";
  Value refused = holder.hold({app(kTools), missing}, 0);
  EXPECT_EQ(refused["errorcode"], Value(9u)) << refused;
  EXPECT_EQ(refused["error"], Value("invalid path: " + missing));
  // An application is no plug-in.
  refused = holder.hold({plugInPath(kTools, "A"), app(kTools)}, 0x1);
  EXPECT_EQ(refused["errorcode"], Value(9u)) << refused;
  EXPECT_EQ(refused["error"], Value("no plug-in at path:" + app(kTools)));
  refused = holder.request({{"request", "lock"}, {"flags", 0}});
  EXPECT_EQ(refused["errorcode"], Value(4u)) << refused;
  EXPECT_EQ(refused["error"], Value("invalid request format"));
  EXPECT_EQ(ready(host, 0), "ready") << "no refused request left a hold";

  // No paths: a hold that blocks nothing, with a token all the same.
  const Value empty = holder.hold({}, 0);
  ASSERT_TRUE(empty["uuids"].uuid()) << empty;
  EXPECT_EQ(ready(host, 1), "ready");
  // A plug-in path holds that plug-in only.
  ASSERT_TRUE(holder.hold({plugInPath(kTools, "C")}, 0x1)["uuids"].uuid());
  EXPECT_EQ(ready(host, 2), heldRefusal(2));
  EXPECT_EQ(ready(host, 1), "ready");
}

TEST_F(Holds, UnlessBusyNamesEveryBusyPlugInInOrderAndHoldsNothing) {
  Host host(daemon_.root(), hostUid_);
  // A and C declare themselves busy; B runs idle.
  startTool(host, 0);
  ASSERT_EQ(host.command("send hold"), "busy");
  startTool(host, 1);
  startTool(host, 2);
  ASSERT_EQ(host.command("send hold"), "busy");

  Client holder(daemon_.service());
  const uint64_t before = notifications();
  const Value refused = holder.hold({app(kTools)}, 0x2 | 0x4);
  EXPECT_EQ(refused["errorcode"], Value(14u)) << refused;
  EXPECT_EQ(refused["error"], Value("plug-ins are busy"));
  EXPECT_EQ(refused["conflicts"], Value(Array{Value(Dictionary{{"BNBundleIdentifier", identifier(0)}}),
                                              Value(Dictionary{{"BNBundleIdentifier", identifier(2)}})}));
  EXPECT_FALSE(refused["uuids"].uuid());
  EXPECT_EQ(notifications(), before);
  EXPECT_EQ(host.command("send still here"), "STILL HERE") << "nothing was terminated";
  EXPECT_EQ(ready(host, 1), "ready") << "no hold was made";

  // Once idle, the same request is granted.
  ASSERT_EQ(host.command("send release"), "idle");
  EXPECT_EQ(holder.hold({plugInPath(kTools, "C")}, 0x1 | 0x2)["errorcode"], Value());
}

TEST_F(Holds, TerminationRepliesOnceEveryInstanceHasGoneWhileTheHoldIsAlreadyInForce) {
  Host host(daemon_.root(), hostUid_);
  std::vector<pid_t> instances;
  for (size_t i = 0; i < kToolNames.size(); ++i) instances.push_back(startTool(host, i));
  // C cannot act on SIGTERM until it is killed, once it has stopped (a
  // SIGTERM that came before the stop took effect would still end it).
  ASSERT_EQ(::kill(instances[2], SIGSTOP), 0);
  ASSERT_TRUE(stopped(instances[2]));

  Client holder(daemon_.service());
  std::future<Value> granted = holder.send({{"request", "lock"}, {"paths", Client::pathArray({app(kTools)})},
                                            {"flags", 0x4}});
  for (size_t i : {0u, 1u})
    ASSERT_TRUE(logged("one or more plug-ins have been terminated for uuid=" + uuids_[i].string())) << daemon_.log();
  ASSERT_TRUE(logged("awaiting termination reply #2"));
  // The hold is in force while the termination is pending; the reply is not sent.
  EXPECT_EQ(ready(host, 2), heldRefusal(2));
  EXPECT_EQ(granted.wait_for(std::chrono::seconds(0)), std::future_status::timeout);
  EXPECT_TRUE(gone(instances[0]) && gone(instances[1]));

  ASSERT_EQ(::kill(instances[2], SIGKILL), 0);
  ASSERT_EQ(granted.wait_for(std::chrono::seconds(30)), std::future_status::ready) << daemon_.log();
  const Value reply = granted.get();
  ASSERT_TRUE(reply["uuids"].uuid()) << reply;
  const std::string complete = "forced termination complete; hold request granted uuid:" + reply["uuids"].uuid()->string();
  ASSERT_TRUE(logged(complete));
  EXPECT_LT(logPosition("terminated for uuid=" + uuids_[2].string()), logPosition(complete));
  EXPECT_TRUE(gone(instances[2]));
  EXPECT_EQ(ask("com.ostrel.tenon.warden", Dictionary{{"request", "list"}})["instances"], Value(Array{}));
}

TEST_F(Holds, AClientsHoldsEndWithItsConnectionOneLineAndOneNotificationEach) {
  Host host(daemon_.root(), hostUid_);
  Client holder(daemon_.service());
  const Value first = holder.hold({app(kTools)}, 0);
  const Value second = holder.hold({}, 0);
  ASSERT_TRUE(first["uuids"].uuid() && second["uuids"].uuid()) << first << second;
  EXPECT_EQ(ready(host, 0), heldRefusal(0));
  const uint64_t before = notifications();

  holder.close();
  const std::string pid = std::to_string(::getpid());
  size_t released = 0;
  for (const Value& token : {first, second}) {
    const std::string line = "releasing plug-in hold " + token["uuids"].uuid()->string() + " for dead client pid " + pid;
    EXPECT_TRUE(logged(line));
    released = std::max(released, logPosition(line));
  }
  // This connection's end, not an earlier connection's of this process: the
  // notifications are posted between the two.
  ASSERT_TRUE(logged("client " + pid + " is dead", released));
  EXPECT_EQ(notifications(), before + 2);
  EXPECT_EQ(ready(host, 0), "ready");
}

TEST_F(Holds, UninstallingAnApplicationTerminatesItsRunningPlugInAndLeavesHoldsAlone) {
  Host host(daemon_.root(), hostUid_);
  const pid_t running = startTool(host, 0);
  Client holder(daemon_.service());
  const tn::UUID kept = tn::test::registeredUUID(daemon_.root(), plugInPath(kKept, "D"));
  ASSERT_TRUE(holder.hold({plugInPath(kKept, "D")}, 0x1)["uuids"].uuid());

  fs::remove_all(app(kTools));
  ASSERT_TRUE(logged("removal complete for")) << daemon_.log();
  EXPECT_NE(logPosition("one or more plug-ins have been terminated for uuid=" + uuids_[0].string()),
            std::string::npos);
  EXPECT_TRUE(gone(running));
  EXPECT_EQ(host.command("ready " + daemon_.service() + " " + kept.string()),
            "error 11 access to plugin com.example.d denied: the plug-in is on hold");
}

// A hold placed by an ordinary user keeps the plug-ins from that user's own
// hosts only; another user's hosts still get them.
TEST_F(Holds, AnOrdinaryUsersHoldReachesOnlyThatUsersHosts) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs a second user: the host runs as 65534 when the test runs as root";
  Host host(daemon_.root(), hostUid_);
  const std::string held = host.command("hold " + daemon_.service() + " 0 " + app(kTools));
  ASSERT_EQ(held.rfind("held ", 0), 0u) << held << daemon_.log();
  EXPECT_EQ(ready(host, 0), heldRefusal(0));
  Client administrator(daemon_.service());
  const Value readied = administrator.request({{"request", "ready"}, {"uuids", Array{Value(uuids_[0])}}});
  EXPECT_EQ(readied["errorcode"], Value()) << readied;
}

}  // namespace
