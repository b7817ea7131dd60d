// The supervisor in this process: registrations that live exactly as long
// as their host process, their limits, starts for this process as host, and
// the answers of removals (0 once every instance is gone, 3 when none ran),
// each given once on the queue the caller named.

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <functional>
#include <thread>

#include "platform/dispatch/SerialQueue.h"
#include "platform/relay/AuditToken.h"
#include "platform/warden/SandboxProfile.h"
#include "platform/warden/Warden.h"
#include "tests/support/TempDirectory.h"

namespace warden {
namespace {

namespace fs = std::filesystem;

bool eventually(const std::function<bool()>& condition) {
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
  while (!condition()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
  return true;
}

tn::Value overlay() {
  return tn::Dictionary{{"RelayService", tn::Dictionary{{"_SandboxProfile", "plugin"}}},
                        {"BNBundlePackageType", "RLY!"}};
}

class SupervisorTest : public ::testing::Test {
 protected:
  SupervisorTest() {
    for (const auto& profile : fs::directory_iterator(TENON_SOURCE_DIR "/packaging/sandbox-profiles")) {
      fs::create_directories(SandboxProfile::directory());
      fs::copy_file(profile.path(), SandboxProfile::directory() + "/" + profile.path().filename().string());
    }
  }

  // A bundle in the root: Info.manifest with `identifier`, and bin/<name>
  // copied from `program` (or holding `script`).
  std::string makeBundle(const std::string& identifier, const std::string& name, const std::string& program,
                         const std::string& script = "") {
    const fs::path bundle = fs::path(root_.path()) / (name + ".bundle");
    fs::create_directories(bundle / "bin");
    std::ofstream(bundle / "Info.manifest") << R"({"BNBundleIdentifier": ")" << identifier
                                            << R"(", "BNBundleVersion": "1.0", "BNBundleExecutable": ")" << name
                                            << R"("})";
    const fs::path executable = bundle / "bin" / name;
    if (script.empty()) {
      fs::copy_file(program, executable, fs::copy_options::overwrite_existing);
    } else {
      std::ofstream(executable) << script;
    }
    fs::permissions(executable, fs::perms(0755));
    return executable.string();
  }

  std::string upcase() {
    return makeBundle("com.example.upcase", "upcase", TENON_BINARY_DIR "/examples/plugins/upcase/upcase");
  }

  // This process, as a peer of its own socket sees it.
  relay::AuditToken ownToken() {
    int ends[2];
    EXPECT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends), 0);
    auto token = relay::AuditToken::ofSocketPeer(ends[0]);
    ::close(ends[0]);
    ::close(ends[1]);
    return *token;
  }

  tn::test::TempRoot root_;
};

// A child that lives until the pipe it reads from is closed.
struct HostChild {
  HostChild() {
    int ends[2];
    EXPECT_EQ(::pipe(ends), 0);
    pid = ::fork();
    if (pid == 0) {
      ::close(ends[1]);
      char byte;
      [[maybe_unused]] const ssize_t n = ::read(ends[0], &byte, 1);
      ::_exit(0);
    }
    ::close(ends[0]);
    release = ends[1];
  }
  void end() {
    ::close(release);
    int status = 0;
    ::waitpid(pid, &status, 0);
  }
  pid_t pid = -1;
  int release = -1;
};

TEST_F(SupervisorTest, ARegistrationEndsWithItsHost) {
  const auto warden = Warden::create();
  HostChild host;
  EXPECT_EQ(warden->addExternalService(host.pid, upcase(), overlay()), 0);
  EXPECT_EQ(warden->registrationCount(), 1u);
  host.end();
  EXPECT_TRUE(eventually([&] { return warden->registrationCount() == 0; }));
  EXPECT_EQ(warden->addExternalService(host.pid, upcase(), overlay()), ESRCH);  // gone: nothing to key by
}

TEST_F(SupervisorTest, RegistrationsAreBoundedPerHostAndReplacedByExecutable) {
  Warden::Limits limits;
  limits.registrationsPerHost = 1;
  const auto warden = Warden::create(limits);
  HostChild host;
  const std::string first = upcase();
  EXPECT_EQ(warden->addExternalService(host.pid, first, overlay()), 0);
  EXPECT_EQ(warden->addExternalService(host.pid, first, overlay()), 0);  // replaces
  const std::string other = makeBundle("com.example.other", "other", first);
  EXPECT_EQ(warden->addExternalService(host.pid, other, overlay()), EUSERS);
  EXPECT_EQ(warden->addExternalService(host.pid, "/nonexistent/bin/x", overlay()), ENOENT);
  EXPECT_EQ(warden->addExternalService(host.pid, first, tn::Dictionary{}), EINVAL);
  EXPECT_EQ(warden->registrationCount(), 1u);
  host.end();
}

TEST_F(SupervisorTest, RemovalWithNothingRunningAnswersThreeOnceOnTheNamedQueue) {
  const auto warden = Warden::create();
  const auto named = tn::dispatch::SerialQueue::create("named");
  std::atomic<int> answers{0};
  std::atomic<int> answer{-1};
  std::atomic<bool> onNamedQueue{false};
  warden->removeExternalService("com.example.upcase", "1.0", named, [&](int status) {
    answer = status;
    onNamedQueue = named->isCurrent();
    ++answers;
  });
  ASSERT_TRUE(eventually([&] { return answers > 0; }));
  EXPECT_EQ(answer, kNoInstancesRunning);
  EXPECT_TRUE(onNamedQueue);
  named->sync([] {});  // anything still queued has run
  EXPECT_EQ(answers, 1);
}

TEST_F(SupervisorTest, StartsOnlyWhatIsRegisteredAndRemovalTerminatesIt) {
  const auto warden = Warden::create();
  const relay::AuditToken self = ownToken();
  EXPECT_EQ(warden->start(self, "com.example.upcase").error().code(), EPERM);
  ASSERT_EQ(warden->addExternalService(self, upcase(), overlay()), 0);
  auto started = warden->start(self, "com.example.upcase");
  ASSERT_TRUE(started.ok()) << started.error().description();
  const pid_t pid = started->instance.pid;
  ASSERT_TRUE(warden->runningInstance(pid, started->instance.startTime));
  const std::string line = "quiet\n";
  ASSERT_EQ(::write(started->hostSocket.get(), line.data(), line.size()), static_cast<ssize_t>(line.size()));
  char answer[6] = {};
  ASSERT_EQ(::read(started->hostSocket.get(), answer, sizeof answer), 6);
  EXPECT_EQ(std::string(answer, 6), "QUIET\n");

  const auto named = tn::dispatch::SerialQueue::create("named");
  std::atomic<int> answers{0};
  std::atomic<int> status{-1};
  // A removal for another user's instances finds none and leaves this one.
  warden->removeExternalService("com.example.upcase", "1.0", named, [&](int value) {
    status = value;
    ++answers;
  }, ::getuid() + 1);
  ASSERT_TRUE(eventually([&] { return answers > 0; }));
  EXPECT_EQ(status, kNoInstancesRunning);
  ASSERT_TRUE(warden->runningInstance(pid, started->instance.startTime));
  answers = 0;
  warden->removeExternalService("com.example.upcase", "1.0", named, [&](int value) {
    status = value;
    ++answers;
  }, ::getuid());
  ASSERT_TRUE(eventually([&] { return answers > 0; }));
  EXPECT_EQ(status, kTerminated);
  EXPECT_EQ(warden->instanceCount(), 0u);
  EXPECT_FALSE(warden->runningInstance(pid, started->instance.startTime));
  EXPECT_EQ(::waitpid(pid, nullptr, WNOHANG), -1);  // reaped already: no zombie left
  named->sync([] {});
  EXPECT_EQ(answers, 1);
}

TEST_F(SupervisorTest, AnInstanceThatIgnoresTerminationIsKilledAfterTheGracePeriod) {
  Warden::Limits limits;
  limits.terminationGrace = std::chrono::milliseconds(200);
  const auto warden = Warden::create(limits);
  const relay::AuditToken self = ownToken();
  const std::string stubborn =
      makeBundle("com.example.stubborn", "stubborn", "", "#!/bin/sh\ntrap '' TERM\nwhile :; do sleep 1; done\n");
  ASSERT_EQ(warden->addExternalService(self, stubborn, overlay()), 0);
  auto started = warden->start(self, "com.example.stubborn");
  ASSERT_TRUE(started.ok()) << started.error().description();
  std::atomic<int> status{-1};
  warden->removeExternalService("com.example.stubborn", "1.0", tn::dispatch::SerialQueue::create("q"),
                                [&](int value) { status = value; });
  ASSERT_TRUE(eventually([&] { return status != -1; }));
  EXPECT_EQ(status, kTerminated);
  EXPECT_EQ(warden->instanceCount(), 0u);
}

}  // namespace
}  // namespace warden
