// A socket-activated tenond (started by systemd-socket-activate on its
// first connection) exits 0 once it has been idle for "idle-exit-seconds",
// and not while a client holds a hold.

#include <gtest/gtest.h>
#include <stdlib.h>

#include <string>
#include <thread>
#include <vector>

#include "tests/service/ServiceTestSupport.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/Subprocess.h"

extern char** environ;

namespace tn::test {
namespace {

constexpr int kIdleSeconds = 1;

std::string launcherPath() {
  for (const char* candidate : {"/usr/bin/systemd-socket-activate", "/bin/systemd-socket-activate"}) {
    if (::access(candidate, X_OK) == 0) return candidate;
  }
  return "";
}

class SocketActivated : public ::testing::Test {
 protected:
  void SetUp() override {
    if (launcherPath().empty()) GTEST_SKIP() << "systemd-socket-activate is not installed (scripts/setup)";
    ::chmod(root_.path().c_str(), 0755);
    writeConfiguration(root_.path(), R"({"idle-exit-seconds": )" + std::to_string(kIdleSeconds) + "}");
    trustDirectoriesBetween(root_.path(), socketPath());
    ::setenv("TENON_ROOT", root_.path().c_str(), 1);
    std::vector<std::string> env;
    for (char** entry = environ; *entry != nullptr; ++entry) env.emplace_back(*entry);
    daemon_ = std::make_unique<ChildProcess>(
        std::vector<std::string>{launcherPath(), "-l", socketPath(), "--fdname=" + service_, "-E",
                                 "TENON_ROOT=" + root_.path(), "-E", "TENON_LOG=debug", tenondBinaryPath(), "-S",
                                 service_},
        env, [] { return true; });
    ASSERT_TRUE(appears(socketPath())) << "the launcher never listened";
  }
  void TearDown() override { ::unsetenv("TENON_ROOT"); }

  std::string socketPath() const { return root_.path() + "/run/tenon/relay/" + service_; }

  TempDirectory root_;
  const std::string service_ = "test.idle." + std::to_string(::getpid());
  std::unique_ptr<ChildProcess> daemon_;
};

TEST_F(SocketActivated, StartsOnAConnectionServesItAndExitsZeroWhenIdle) {
  {
    OpenClient client(service_);
    const Value hold = client.holdNothing();
    ASSERT_TRUE(hold["uuids"].uuid()) << hold.description();
    EXPECT_EQ(client.request({{"request", "lock"}, {"uuids", Array{hold["uuids"]}}})["errorcode"], Value());
  }
  const ProcessResult ended = daemon_->finish();  // returns once the daemon has exited
  EXPECT_EQ(ended.exitStatus, 0) << ended.err;
  EXPECT_NE(ended.err.find("socket-activated: exiting after 1 seconds idle"), std::string::npos) << ended.err;
  const size_t granted = ended.err.find("hold request granted");
  const size_t exiting = ended.err.find("idle for 1 seconds (no connection, hold or plug-in instance): exiting");
  ASSERT_NE(exiting, std::string::npos) << ended.err;
  EXPECT_LT(granted, exiting) << "it served the client before it went";
}

TEST_F(SocketActivated, DoesNotExitWhileAHoldStands) {
  OpenClient holder(service_);
  ASSERT_TRUE(holder.holdNothing()["uuids"].uuid());
  // Twice the idle time with the hold in place: the daemon must still answer.
  std::this_thread::sleep_for(std::chrono::seconds(2 * kIdleSeconds) + std::chrono::milliseconds(500));
  OpenClient later(service_);
  EXPECT_TRUE(later.holdNothing()["uuids"].uuid()) << "the daemon went while a hold stood";
  later.close();
  holder.close();
  const ProcessResult ended = daemon_->finish();
  EXPECT_EQ(ended.exitStatus, 0) << ended.err;
  EXPECT_NE(ended.err.find("releasing plug-in hold"), std::string::npos) << ended.err;
  EXPECT_LT(ended.err.find("releasing plug-in hold"), ended.err.find("): exiting")) << ended.err;
}

}  // namespace
}  // namespace tn::test
