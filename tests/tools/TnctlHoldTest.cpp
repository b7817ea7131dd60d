// tnctl hold and tnctl release, run as users run them: against the real
// tenond on a private root holding the Notes application (data plug-ins, so
// "ready" answers at once when no hold stands), and against a fake daemon
// for what the real one gives only with running plug-ins (busy refusals).

#include <gtest/gtest.h>

#include <fcntl.h>
#include <signal.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include <fmt/format.h>

#include "platform/value/Document.h"
#include "tests/e2e/AnnotationTestSupport.h"
#include "tests/libtenon/client/FakeDaemon.h"
#include "tests/support/Subprocess.h"

namespace tn::test {
namespace {

constexpr auto kDeadline = std::chrono::seconds(10);

// The first line of the file at `path` once it is complete, waiting up to
// kDeadline; empty if none came.
std::string firstLineOf(const std::string& path) {
  for (const auto until = std::chrono::steady_clock::now() + kDeadline; std::chrono::steady_clock::now() < until;) {
    std::ifstream file(path);
    std::stringstream text;
    text << file.rdbuf();
    const std::string content = text.str();
    if (const size_t end = content.find('\n'); end != std::string::npos) return content.substr(0, end);
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  return {};
}

class TnctlHold : public NotesDaemonTest {
 protected:
  TnctlHold() : NotesDaemonTest({"Jot", "Sketch"}) {}

  std::string application() const { return daemon_.root() + "/opt/tenon/applications/Notes"; }

  ProcessResult tnctl(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), kTnctl);
    arguments.insert(arguments.end(), {"--service", daemon_.service()});
    return runProcess(arguments, daemon_.environment());
  }

  // "ready" for plug-in `index` with tnctl as the host.
  ProcessResult ready(size_t index) { return tnctl({"ready", fmt::format("{}={}", uuids_.at(index), paths_.at(index))}); }

  std::string onHoldRefusal(size_t index) const {
    return fmt::format("tnctl: error 11: access to plugin com.example.notes.{} denied: the plug-in is on hold\n",
                       names_.at(index));
  }

  // `tnctl hold --wait` with the arguments, its stdout going to a file so
  // that the token can be read while it runs.
  std::unique_ptr<ChildProcess> holdAndWait(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), {kTnctl, "hold", "--wait"});
    arguments.insert(arguments.end(), {"--service", daemon_.service()});
    const std::string out = tokenFile_;
    return std::make_unique<ChildProcess>(arguments, environmentWith(daemon_.environment()), [out] {
      const int fd = ::open(out.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
      return fd >= 0 && ::dup2(fd, STDOUT_FILENO) == STDOUT_FILENO;
    });
  }

  // Whether the daemon logged `line`, waiting up to kDeadline.
  bool daemonLogs(const std::string& line) {
    for (const auto until = std::chrono::steady_clock::now() + kDeadline; std::chrono::steady_clock::now() < until;) {
      if (daemon_.log().find(line) != std::string::npos) return true;
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return false;
  }

  std::string deadClientRelease(const std::string& token, pid_t pid) const {
    return fmt::format("releasing plug-in hold {} for dead client pid {}", token, pid);
  }

  const std::string tokenFile_ = daemon_.root() + "/hold-token";
};

TEST_F(TnctlHold, WaitKeepsTheHoldUntilSigtermAndThePlugInsAreRefusedMeanwhile) {
  auto holder = holdAndWait({application()});
  const pid_t pid = holder->pid();
  const std::string token = firstLineOf(tokenFile_);
  ASSERT_TRUE(UUID::parse(token)) << "no token printed: '" << token << "'\n" << daemon_.log();

  for (size_t index : {0u, 1u}) {
    const ProcessResult refused = ready(index);
    EXPECT_EQ(refused.exitStatus, 1);
    EXPECT_EQ(refused.err, onHoldRefusal(index));
  }
  EXPECT_EQ(daemon_.log().find(deadClientRelease(token, pid)), std::string::npos) << "the hold ended early";

  ASSERT_EQ(::kill(pid, SIGTERM), 0);
  const ProcessResult ended = holder->finish();
  EXPECT_EQ(ended.exitStatus, 0) << ended.err;
  EXPECT_EQ(ended.err, "tnctl: holding until SIGINT or SIGTERM\n");
  ASSERT_TRUE(daemonLogs(deadClientRelease(token, pid))) << daemon_.log();
  const ProcessResult readied = ready(0);
  EXPECT_EQ(readied.exitStatus, 0) << readied.err;
}

// A daemon that stops takes the hold with it: tnctl says so instead of
// claiming to hold on.
TEST_F(TnctlHold, WaitEndsWithStatusOneWhenTheDaemonGoes) {
  auto holder = holdAndWait({application()});
  ASSERT_TRUE(UUID::parse(firstLineOf(tokenFile_))) << daemon_.log();
  EXPECT_EQ(daemon_.terminate(), 0);
  const ProcessResult ended = holder->finish();
  EXPECT_EQ(ended.exitStatus, 1) << ended.err;
  EXPECT_NE(ended.err.find("tnctl: the connection to tenond broke; the hold ended with it\n"), std::string::npos)
      << ended.err;
}

TEST_F(TnctlHold, ReleaseFromAnotherProcessEndsTheHold) {
  auto holder = holdAndWait({"--plugins", paths_.at(1)});
  const std::string token = firstLineOf(tokenFile_);
  ASSERT_TRUE(UUID::parse(token)) << "no token printed: '" << token << "'\n" << daemon_.log();
  EXPECT_EQ(ready(1).err, onHoldRefusal(1));
  EXPECT_EQ(ready(0).exitStatus, 0) << "only the named plug-in is held";

  const ProcessResult released = tnctl({"release", token});
  EXPECT_EQ(released.exitStatus, 0) << released.err;
  EXPECT_EQ(released.out, "released\n");
  ASSERT_TRUE(daemonLogs(fmt::format("releasing plug-in hold {} at client's request", token))) << daemon_.log();
  const ProcessResult readied = ready(1);
  EXPECT_EQ(readied.exitStatus, 0) << readied.err;
  EXPECT_EQ(tnctl({"release", token}).out, "released\n") << "a token of no hold is no error";

  ASSERT_EQ(::kill(holder->pid(), SIGINT), 0);
  EXPECT_EQ(holder->finish().exitStatus, 0);
}

// Without --wait the hold is tnctl's for as long as it runs: it is placed,
// its token printed, and it ends as tnctl exits.
TEST_F(TnctlHold, WithoutWaitTheHoldEndsWithTnctlAndJsonCarriesTheToken) {
  const ProcessResult held = tnctl({"--json", "hold", application()});
  ASSERT_EQ(held.exitStatus, 0) << held.err;
  const Result<Value> reply = readDocument(held.out, "stdout", DocumentEncoding::Json);
  ASSERT_TRUE(reply) << held.out;
  const std::string* token = (*reply)["uuids"].string();
  ASSERT_NE(token, nullptr) << held.out;
  EXPECT_TRUE(UUID::parse(*token)) << *token;
  EXPECT_TRUE(daemonLogs(fmt::format("releasing plug-in hold {} for dead client pid", *token))) << daemon_.log();

  const ProcessResult plain = tnctl({"hold", application()});
  ASSERT_EQ(plain.exitStatus, 0) << plain.err;
  ASSERT_EQ(plain.out.size(), 37u) << plain.out;
  EXPECT_TRUE(UUID::parse(plain.out.substr(0, 36))) << plain.out;
  EXPECT_EQ(plain.err, "");
}

TEST_F(TnctlHold, BadPathsAndTokensAreNamed) {
  const std::string missing = daemon_.root() + "/opt/tenon/applications/Missing";
  const ProcessResult invalid = tnctl({"hold", missing});
  EXPECT_EQ(invalid.exitStatus, 1);
  EXPECT_EQ(invalid.err, fmt::format("tnctl: error 9: invalid path: {}\n", missing));
  EXPECT_EQ(invalid.out, "");

  const ProcessResult notPlugIn = tnctl({"hold", "--plugins", application()});
  EXPECT_EQ(notPlugIn.exitStatus, 1);
  EXPECT_EQ(notPlugIn.err, fmt::format("tnctl: error 9: no plug-in at path:{}\n", application()));

  const ProcessResult token = tnctl({"release", "not-a-token"});
  EXPECT_EQ(token.exitStatus, 1);
  EXPECT_EQ(token.err, "tnctl: invalid hold token: not-a-token (a token is a UUID, as tnctl hold prints it)\n");

  EXPECT_NE(tnctl({"hold"}).exitStatus, 0) << "a hold names what it holds";
  EXPECT_EQ(ready(0).exitStatus, 0) << "no hold was left behind";
}

// The requests tnctl builds, and the busy refusal the real daemon gives only
// when plug-ins are running: a fake daemon answers.
class TnctlHoldRequests : public ::testing::Test {
 protected:
  static Value answer(const Value& request) {
    const uint64_t flags = request["flags"].uint64().value_or(0);
    if (request.dictionary()->contains("paths") && (flags & 0x2)) {
      return Value(Dictionary{
          {"conflicts", Value(Array{Value(Dictionary{{"BNBundleIdentifier", Value("com.example.notes.Jot")}}),
                                    Value(Dictionary{{"pid", Value(uint64_t{42})}})})},
          {"errorcode", Value(uint64_t{14})},
          {"error", Value("plug-ins are busy")}});
    }
    return Value(Dictionary());
  }

  ProcessResult tnctl(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), kTnctl);
    arguments.insert(arguments.end(), {"--service", "fake"});
    const std::string root = root_.path();
    return runProcess(arguments, {"TENON_ROOT=" + root});
  }

  TempRoot root_;
  FakeDaemon daemon_{"fake", answer};
};

TEST_F(TnctlHoldRequests, OptionsBecomeFlagsAndBusyPlugInsAreNamed) {
  const std::string cwd = std::filesystem::current_path().string();
  EXPECT_EQ(tnctl({"hold", "--plugins", "--terminate", "relative/A.tnx", "/opt/B.tnx"}).exitStatus, 0);
  const ProcessResult busy = tnctl({"hold", "--unless-busy", "/opt/Notes"});
  EXPECT_EQ(busy.exitStatus, 1);
  EXPECT_EQ(busy.out, "busy: com.example.notes.Jot\nbusy: {pid: 42}\n");
  EXPECT_EQ(busy.err, "tnctl: error 14: plug-ins are busy\n");
  const std::string token = "0F3C6D2E-8E51-4D5F-9A0B-3C2D1E0F4A5B";
  EXPECT_EQ(tnctl({"release", token}).exitStatus, 0);

  const std::vector<Value> requests = daemon_.waitForRequests(3);
  ASSERT_EQ(requests.size(), 3u);
  EXPECT_EQ(requests[0]["request"], Value("lock"));
  EXPECT_EQ(requests[0]["flags"], Value(uint64_t{0x5}));
  EXPECT_EQ(requests[0]["paths"], Value(Array{Value(cwd + "/relative/A.tnx"), Value("/opt/B.tnx")}));
  EXPECT_EQ(requests[1]["flags"], Value(uint64_t{0x2}));
  EXPECT_EQ(requests[2]["uuids"], Value(Array{Value(*UUID::parse(token))}));
  EXPECT_FALSE(requests[2].dictionary()->contains("paths")) << "a release names no paths";
}

}  // namespace
}  // namespace tn::test
