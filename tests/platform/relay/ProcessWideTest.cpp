// What is process-wide: socket activation, readiness, termination and the
// keep-alive count.
//
// Scenarios that need a process of their own (a socket at fd 3 and a
// LISTEN_PID naming the process, as systemd passes them; or a termination
// announcement, which stays for good) re-execute this test program with
// RELAY_TEST_SCENARIO=<name>. A static initializer runs the scenario before
// GoogleTest starts and exits with its result (0: success), so scenarios
// are not tests of their own.

#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <thread>

#include "platform/dispatch/Semaphore.h"
#include "platform/relay/KeepAlive.h"
#include "platform/relay/SocketActivation.h"
#include "platform/relay/Termination.h"
#include "tests/platform/relay/RelayTestSupport.h"

extern char** environ;

namespace relay {
namespace {

using tn::dispatch::SerialQueue;

// Scenario: serve the socket passed for "activated", answering each request
// with this process's pid; end when the peer goes.
int serveOnActivatedSocket() {
  auto listener = Listener::create("activated", SerialQueue::create("scenario"));
  if (!listener.ok() || !(*listener)->isSocketActivated()) return 10;
  const auto done = std::make_shared<tn::dispatch::Semaphore>();
  (*listener)->setNewConnectionHandler([done](std::shared_ptr<Connection> connection) {
    connection->setEventHandler([done, weak = std::weak_ptr(connection)](const Event& event) {
      if (const auto self = weak.lock(); self && event.kind == Event::Kind::Message) {
        self->sendReply(event.message, tn::Value(tn::Dictionary{{"pid", ::getpid()}}));
      }
      if (event.kind == Event::Kind::ConnectionInvalid) done->signal();
    });
    connection->resume();
  });
  (*listener)->resume();
  if (!done->waitFor(test::kPatience)) return 11;
  return ::access(test::pathOf("activated").c_str(), F_OK) == 0 ? 12 : 0;  // no socket of its own
}

// Scenario: with LISTEN_FDNAMES=other, the passed socket is for "other" only.
int adoptOnlyByName() {
  const auto queue = SerialQueue::create("scenario");
  auto mine = Listener::create("activated", queue);
  auto other = Listener::create("other", queue);
  if (!mine.ok() || (*mine)->isSocketActivated()) return 20;
  return other.ok() && (*other)->isSocketActivated() ? 0 : 21;
}

// Scenario: terminationImminent() reaches each server connection once, live
// or accepted later, and not the client side.
int announceTermination() {
  test::Recorder<std::shared_ptr<test::EventRecorder>> serverEvents;
  auto listener = Listener::create("terminating", SerialQueue::create("scenario"));
  (*listener)->setNewConnectionHandler([&](std::shared_ptr<Connection> connection) {
    auto events = std::make_shared<test::EventRecorder>();
    connection->setEventHandler(events->handler());
    connection->resume();
    serverEvents.add(events);
  });
  (*listener)->resume();
  auto before = std::make_unique<test::Client>("terminating");
  if (!test::eventually([&] { return serverEvents.size() == 1; })) return 30;
  terminationImminent();
  terminationImminent();
  auto after = std::make_unique<test::Client>("terminating");
  if (!test::eventually([&] { return serverEvents.size() == 2; })) return 31;
  const int clientSide = before->events.count(Event::Kind::TerminationImminent);
  before.reset();
  after.reset();
  for (const auto& events : serverEvents.snapshot()) {
    if (!events->waitForKind(Event::Kind::ConnectionInvalid)) return 32;
    if (events->count(Event::Kind::TerminationImminent) != 1) return 33;
  }
  return clientSide == 0 ? 0 : 34;
}

const bool scenarioRan = [] {
  const char* name = std::getenv("RELAY_TEST_SCENARIO");
  if (name == nullptr) return false;
  const std::string scenario = name;
  const int code = scenario == "activation"   ? serveOnActivatedSocket()
                   : scenario == "by-name"    ? adoptOnlyByName()
                   : scenario == "terminate"  ? announceTermination()
                                              : 99;
  std::fflush(nullptr);
  std::_Exit(code);
}();

// Runs this program as `scenario` with extra environment entries. With
// passFd >= 0 that socket becomes fd 3 and LISTEN_FDS=1 / LISTEN_PID=<child>
// are set, as systemd does. Returns the child's pid.
pid_t startScenario(const std::string& scenario, std::vector<std::string> environment, int passFd = -1) {
  // Prepared before fork: a child of a threaded process may only make
  // async-signal-safe calls until it execs.
  for (char** entry = environ; *entry != nullptr; ++entry) environment.emplace_back(*entry);
  environment.push_back("RELAY_TEST_SCENARIO=" + scenario);
  std::vector<char*> envp;
  for (std::string& entry : environment) envp.push_back(entry.data());
  envp.push_back(nullptr);
  // The shell knows its pid ($$), and exec keeps it.
  std::string shell = "/bin/sh", dashC = "-c";
  std::string script = passFd >= 0 ? "LISTEN_FDS=1 LISTEN_PID=$$ exec \"$0\"" : "exec \"$0\"";
  std::string program = std::filesystem::read_symlink("/proc/self/exe");
  char* argv[] = {shell.data(), dashC.data(), script.data(), program.data(), nullptr};
  const pid_t child = ::fork();
  if (child != 0) return child;
  if (passFd >= 0 && (::dup2(passFd, 3) != 3 || ::fcntl(3, F_SETFD, 0) != 0)) ::_exit(126);
  ::execve(argv[0], argv, envp.data());
  ::_exit(127);
}

int exitStatusOf(pid_t child) {
  int status = 0;
  return ::waitpid(child, &status, 0) == child && WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

UniqueFd boundSocket(const std::string& path, int type) {
  UniqueFd socket(::socket(AF_UNIX, type | SOCK_CLOEXEC, 0));
  sockaddr_un address{AF_UNIX, {}};
  path.copy(address.sun_path, sizeof address.sun_path - 1);
  if (::bind(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) socket.reset();
  if (type == SOCK_STREAM && ::listen(socket.get(), 8) != 0) socket.reset();
  return socket;
}

class ProcessWideTest : public test::RelayTest {};

TEST_F(ProcessWideTest, ListenerServesOnTheSocketSystemdPassed) {
  const std::string path = root_.path() + "/activation.sock";  // not the service path
  const pid_t child = startScenario("activation", {}, boundSocket(path, SOCK_STREAM).get());
  test::RawClient client(path);
  client.write(test::rawFrame(1, 0, test::numbered(1)));
  const std::optional<RawFrame> reply = client.readFrame();
  ASSERT_TRUE(reply.has_value());
  EXPECT_EQ(reply->replyTo, 1u);
  EXPECT_EQ(decodeFrameBody(reply->body).value()["pid"], tn::Value(child));
  client.close();  // the scenario ends when its peer goes
  EXPECT_EQ(exitStatusOf(child), 0);
}

TEST_F(ProcessWideTest, NamedPassedSocketsGoOnlyToTheirService) {
  const UniqueFd passed = boundSocket(root_.path() + "/named.sock", SOCK_STREAM);
  EXPECT_EQ(exitStatusOf(startScenario("by-name", {"LISTEN_FDNAMES=other"}, passed.get())), 0);
  EXPECT_FALSE(takeActivatedSocket("anything").valid()) << "nothing was passed to this process";
}

TEST_F(ProcessWideTest, TerminationReachesEveryServerConnectionOnce) {
  EXPECT_EQ(exitStatusOf(startScenario("terminate", {})), 0);
}

TEST_F(ProcessWideTest, ReadinessGoesToTheNotifySocket) {
  const std::string path = root_.path() + "/notify.sock";
  const UniqueFd notify = boundSocket(path, SOCK_DGRAM);
  ::setenv("NOTIFY_SOCKET", path.c_str(), 1);
  notifyReady();
  ::unsetenv("NOTIFY_SOCKET");
  char message[16] = {};
  EXPECT_EQ(::recv(notify.get(), message, sizeof message - 1, MSG_DONTWAIT), 7);
  EXPECT_STREQ(message, "READY=1");
  notifyReady();  // without a notify socket it does nothing
}

TEST(KeepAlive, CountsTransactionsFromAnyThread) {
  transactionBegin();
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([] {
      for (int i = 0; i < 10000; ++i) transactionBegin(), transactionEnd();
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(keepAliveCount(), 1u);
  transactionEnd();
  EXPECT_EQ(keepAliveCount(), 0u);
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(transactionEnd(), "without a transactionBegin");
}

}  // namespace
}  // namespace relay
