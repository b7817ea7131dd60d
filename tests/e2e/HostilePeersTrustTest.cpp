// Hostile peers against the real tenond: the manager entitlement needs a
// privileged user as well, entitlements belong to the file a peer runs (an
// exec after connecting, or another file mounted over an entitled path in
// the peer's own mount namespace, gets none), and a peer under a seccomp
// filter is seen as sandboxed. Everything trusted is installed into the
// daemon's private root with the modes the trust rule wants.

#include <gtest/gtest.h>

#include <fcntl.h>
#include <grp.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstring>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "tests/platform/bundle/BundleTestSupport.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/SeccompFilter.h"
#include "tests/support/Subprocess.h"
#include "tests/support/TrustedInstall.h"

extern char** environ;

namespace tn::test {
namespace {

const std::string kTnctl = std::string(TENON_BINARY_DIR "/tools/tnctl/tnctl");
const std::string kClient = std::string(TENON_BINARY_DIR "/tests/e2e/exec_after_connect");
constexpr uid_t kNobody = 65534;
constexpr gid_t kAdministrators = 4242;
constexpr int kInheritedFd = 100;  // where the exec-after-connect child keeps its socket

std::string managerDocument(const std::string& executable) {
  return R"({"executable": ")" + executable + R"(", "entitlements": {"com.ostrel.private.tenon.manager": true}})";
}

// The daemon's root before it starts: entitled copies of tnctl and of the
// test client, their documents, and group 4242 as the privileged group.
void prepareRoot(const std::string& root) {
  installFile(kTnctl, root, "usr/bin/tnctl");
  installFile(kClient, root, "usr/bin/entitled-client");
  writeFile(root + "/etc/tenon/entitlements.d/tnctl.manifest", managerDocument(root + "/usr/bin/tnctl"));
  writeFile(root + "/etc/tenon/entitlements.d/client.manifest", managerDocument(root + "/usr/bin/entitled-client"));
  writeFile(root + "/etc/tenon/tenond.manifest", R"({"privileged-groups": [4242]})");
}

using Child = ChildProcess;

class HostileTrust : public ::testing::Test {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "trusted files must be root's, and other users are made from root";
    ASSERT_TRUE(daemon_.accepting()) << daemon_.log();
    bundle_ = daemon_.root() + "/System/Library/PlugIns/Victim.bundle";
    makeBundle(bundle_, R"({"BNBundleIdentifier": "com.example.victim", "BNBundleVersion": "1",
        "XTExtension": {"XTExtensionPointIdentifier": "com.example.thumbnails",
                        "XTExtensionProtocol": "com.example.protocol"}})");
    register_();
  }

  std::string entitledTnctl() const { return daemon_.root() + "/usr/bin/tnctl"; }
  std::string entitledClient() const { return daemon_.root() + "/usr/bin/entitled-client"; }
  std::string removeRequest() const {
    return R"({"request":"remove","version":3,"paths":[")" + bundle_ + R"("]})";
  }

  std::vector<std::string> environment() const {
    std::vector<std::string> env;
    for (char** entry = environ; *entry; ++entry)
      if (!std::string_view(*entry).starts_with("TENON_")) env.emplace_back(*entry);
    env.push_back("TENON_ROOT=" + daemon_.root());
    return env;
  }

  // The entitled tnctl, run by root.
  ProcessResult tnctl(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), entitledTnctl());
    arguments.insert(arguments.end(), {"--service", daemon_.service()});
    return runProcess(arguments, daemon_.environment());
  }

  // The entitled tnctl removing the victim, run by uid and gid 65534 with
  // the supplementary groups given.
  ProcessResult removeAsNobody(std::vector<gid_t> groups) {
    Child child({entitledTnctl(), "remove", bundle_, "--service", daemon_.service()}, environment(), [&] {
      return ::setgroups(groups.size(), groups.data()) == 0 && ::setgid(kNobody) == 0 && ::setuid(kNobody) == 0;
    });
    return child.finish();
  }

  void register_() { ASSERT_EQ(tnctl({"add", bundle_}).exitStatus, 0); }
  bool registered() { return tnctl({"registry", "list"}).out.find("com.example.victim") != std::string::npos; }

  // The daemon's log line that contains text, once it is there (bounded).
  std::optional<std::string> logLine(const std::string& text) {
    for (int i = 0; i < 500; ++i) {
      const std::string log = daemon_.log();
      const std::size_t at = log.find(text);
      if (at != std::string::npos) {
        const std::size_t start = log.rfind('\n', at);
        const std::size_t end = log.find('\n', at);
        return log.substr(start == std::string::npos ? 0 : start + 1, end == std::string::npos ? end : end - start - 1);
      }
      std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    return std::nullopt;
  }
  std::string identifiedLine(pid_t pid) {
    return logLine("client " + std::to_string(pid) + " identified").value_or("(never identified)");
  }

  // Once the daemon has identified the child (with `entitlements` in its
  // line), lets it exec (one byte on goWrite) and checks that both its
  // "remove" requests, sent after the exec, were refused.
  void execAfterIdentification(Child& child, int goWrite, const std::string& entitlements) {
    EXPECT_NE(identifiedLine(child.pid()).find(entitlements), std::string::npos) << daemon_.log();
    ASSERT_EQ(::write(goWrite, "x", 1), 1);
    ::close(goWrite);
    const ProcessResult result = child.finish();
    EXPECT_EQ(result.exitStatus, 0) << result.err;
    EXPECT_EQ(result.out, "11\n11\n") << "both requests refused";
    EXPECT_TRUE(registered());
  }

  DaemonProcess daemon_{tenondBinaryPath(), {}, prepareRoot};
  std::string bundle_;
};

TEST_F(HostileTrust, RemovingNeedsAPrivilegedUserAsWellAsTheManagerEntitlement) {
  const ProcessResult refused = removeAsNobody({});
  EXPECT_EQ(refused.exitStatus, 1);
  EXPECT_EQ(refused.err, "tnctl: error 11: caller lacks entitlement for this operation\n");
  EXPECT_TRUE(logLine("to remove plug-in at " + bundle_ + " - client lacks required entitlement"));
  EXPECT_TRUE(registered());

  const ProcessResult member = removeAsNobody({kAdministrators});
  EXPECT_EQ(member.exitStatus, 0) << member.err;
  EXPECT_FALSE(registered());

  register_();
  const ProcessResult root = tnctl({"remove", bundle_});
  EXPECT_EQ(root.exitStatus, 0) << root.err;
  EXPECT_FALSE(registered());
}

// The child connects as the test program, waits until the daemon has
// identified it, then execs the entitled client, which sends its requests
// on the socket it inherited: the connection made before the exec.
TEST_F(HostileTrust, AConnectionMadeBeforeExecutingAnEntitledProgramGetsNoEntitlement) {
  const std::string socketPath = daemon_.socketPath();
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::memcpy(address.sun_path, socketPath.c_str(), socketPath.size() + 1);
  int go[2];
  ASSERT_EQ(::pipe2(go, O_CLOEXEC), 0);
  Child child({entitledClient(), "--as-entitled", "--fd", std::to_string(kInheritedFd), removeRequest(),
               removeRequest()},
              environment(), [&] {
                const int fd = ::socket(AF_UNIX, SOCK_STREAM, 0);
                if (::connect(fd, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) return false;
                if (::dup2(fd, kInheritedFd) != kInheritedFd) return false;  // without close-on-exec
                char byte;
                return ::read(go[0], &byte, 1) == 1;
              });
  ::close(go[0]);
  execAfterIdentification(child, go[1], "entitlements 0");

  // The same program connecting by itself is entitled.
  const ProcessResult direct = runProcess({entitledClient(), "--service", daemon_.service(), removeRequest()},
                                          daemon_.environment());
  EXPECT_EQ(direct.out, "0\n") << direct.err;
  EXPECT_FALSE(registered());
}

// The other way round: the entitled client connects, is identified with its
// entitlement, then execs a program nobody entitled (the build's own copy of
// the client) that goes on with the same connection.
TEST_F(HostileTrust, AnEntitledPeerThatExecsAnotherProgramLosesItsEntitlements) {
  int go[2];
  ASSERT_EQ(::pipe2(go, O_CLOEXEC), 0);
  // The client keeps its socket as descriptor 100 across the exec.
  Child child({entitledClient(), "--service", daemon_.service(), "--exec", kClient, "--as-entitled", "--fd",
               std::to_string(kInheritedFd), removeRequest(), removeRequest()},
              environment(), [&] { return ::dup2(go[0], STDIN_FILENO) == STDIN_FILENO; });
  ::close(go[0]);
  const pid_t pid = child.pid();
  execAfterIdentification(child, go[1], "entitlements 1");
  const std::string log = daemon_.log();
  const std::string said = "client " + std::to_string(pid) + " (" + entitledClient() +
                           ") holds no entitlements from now on";
  const std::size_t first = log.find(said);
  EXPECT_NE(first, std::string::npos) << log;
  EXPECT_EQ(log.find(said, first + 1), std::string::npos) << "said once";
}

// Another file mounted over the entitled tnctl's path in the peer's own
// mount namespace: the daemon sees that path in the peer's view, but the
// entitlement belongs to the file at that path in its own.
TEST_F(HostileTrust, AnotherFileMountedOverAnEntitledPathGetsNoEntitlement) {
  // Trusted modes, but another file.
  const std::string impostor = installFile(kTnctl, daemon_.root(), "opt/impostor/tnctl");
  const std::string target = entitledTnctl();
  Child child({target, "remove", bundle_, "--service", daemon_.service()}, environment(), [&] {
    return ::unshare(CLONE_NEWNS) == 0 && ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0 &&
           ::mount(impostor.c_str(), target.c_str(), nullptr, MS_BIND, nullptr) == 0;
  });
  const ProcessResult result = child.finish();
  if (result.exitStatus == ChildProcess::kSetUpFailed) GTEST_SKIP() << "unshare(CLONE_NEWNS) or mount is not permitted here";
  EXPECT_EQ(result.exitStatus, 1);
  EXPECT_EQ(result.err, "tnctl: error 11: caller lacks entitlement for this operation\n");
  EXPECT_TRUE(registered());

  EXPECT_EQ(tnctl({"remove", bundle_}).exitStatus, 0) << "the file at the path itself is entitled";
}

TEST_F(HostileTrust, APeerUnderASeccompFilterIsSandboxed) {
  const std::string socketPath = daemon_.socketPath();
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::memcpy(address.sun_path, socketPath.c_str(), socketPath.size() + 1);
  for (const bool sandboxed : {true, false}) {
    int release[2];
    ASSERT_EQ(::pipe2(release, O_CLOEXEC), 0);
    // The child stays connected until the test closes the pipe; it never
    // reaches its exec.
    Child child({"/bin/true"}, {}, [&] {
      ::close(release[1]);
      if (sandboxed && !installAllowAllFilter()) return false;
      const int fd = ::socket(AF_UNIX, SOCK_STREAM, 0);
      if (::connect(fd, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) return false;
      char byte;
      while (::read(release[0], &byte, 1) > 0) {
      }
      return true;
    });
    ::close(release[0]);
    const std::string line = identifiedLine(child.pid());
    EXPECT_TRUE(line.ends_with(sandboxed ? "entitlements 0 sandboxed" : "entitlements 0 not sandboxed")) << line;
    ::close(release[1]);
    child.finish();
  }
}

}  // namespace
}  // namespace tn::test
