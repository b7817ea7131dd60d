// A system instance and a per-user instance side by side on one platform
// root: each keeps its own annotation file, and an election made through
// one does not show through the other.

#include <gtest/gtest.h>
#include <signal.h>

#include <string>
#include <vector>

#include "tests/e2e/AnnotationTestSupport.h"
#include "tests/service/ServiceTestSupport.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/Subprocess.h"

extern char** environ;

namespace tn::test {
namespace {

class Instances : public ::testing::Test {
 protected:
  Instances()
      : system_(tenondBinaryPath(), {}, [this](const std::string& root) { plugIns_ = installNotes(root, {"A"}); }) {}

  // The per-user instance's variables: same root and service name, its own
  // XDG directories.
  std::vector<std::string> userVariables() const {
    return {"TENON_ROOT=" + system_.root(), "TENON_INSTANCE=user", "XDG_RUNTIME_DIR=" + home_ / "run",
            "XDG_STATE_HOME=" + home_ / "state", "XDG_CACHE_HOME=" + home_ / "cache",
            "XDG_CONFIG_HOME=" + home_ / "config", "TENON_LOG=debug"};
  }

  std::unique_ptr<ChildProcess> startUserInstance() {
    std::vector<std::string> env;
    for (char** entry = environ; *entry != nullptr; ++entry) {
      const std::string text(*entry);
      if (!text.starts_with("TENON_") && !text.starts_with("XDG_")) env.push_back(text);
    }
    for (const std::string& variable : userVariables()) env.push_back(variable);
    makeDirectory(home_ / "run");
    return std::make_unique<ChildProcess>(std::vector<std::string>{tenondBinaryPath(), "-S", system_.service()},
                                          env, [] { return true; });
  }

  ProcessResult elect(const std::vector<std::string>& variables) {
    return runProcess(
        {kTnctl, "annotate", "--service", system_.service(), "--path", plugIns_.at(0), "--election", "1"},
        variables);
  }

  std::vector<std::string> plugIns_;
  DaemonProcess system_;
  TempDirectory home_;
};

TEST_F(Instances, EachKeepsItsOwnElections) {
  ASSERT_TRUE(system_.accepting()) << system_.log();
  const std::unique_ptr<ChildProcess> user = startUserInstance();
  ASSERT_TRUE(socketAccepts(home_ / "run/tenon/relay/" + system_.service()));
  ASSERT_FALSE(registeredUUID(system_.root(), plugIns_.at(0)).isNil()) << system_.log();

  // The user's tnctl reaches the user's instance through the same variables.
  const ProcessResult elected = elect(userVariables());
  ASSERT_EQ(elected.exitStatus, 0) << elected.err;

  const std::string userFile = home_ / "state/tenon/Tenon-Annotations";
  const std::string systemFile = system_.root() + "/var/db/Tenon-Annotations";
  const Value userElections = storedAnnotations(userFile);
  ASSERT_TRUE(userElections.isDictionary()) << "the user's instance saved nothing in " << userFile;
  EXPECT_EQ(userElections.dictionary()->size(), 1u) << userElections.description();
  EXPECT_TRUE(storedAnnotations(systemFile).isNull() || storedAnnotations(systemFile).dictionary()->empty())
      << "the election reached the system instance: " << storedAnnotations(systemFile).description();

  // And an election through the system instance stays there.
  const ProcessResult systemElected = elect(system_.environment());
  ASSERT_EQ(systemElected.exitStatus, 0) << systemElected.err;
  EXPECT_EQ(storedAnnotations(systemFile).dictionary()->size(), 1u) << system_.log();
  EXPECT_EQ(storedAnnotations(userFile), userElections) << "the system instance wrote the user's file";

  ::kill(user->pid(), SIGTERM);
  EXPECT_EQ(user->finish().exitStatus, 0);
}

}  // namespace
}  // namespace tn::test
