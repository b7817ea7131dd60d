#include "platform/relay/AuditToken.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <grp.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>

#include "platform/relay/PeerIdentity.h"
#include "platform/relay/ProcessStartTime.h"
#include "platform/relay/RelayError.h"
#include "platform/sandbox/SandboxCheck.h"
#include "tests/support/SeccompFilter.h"
#include "tests/platform/relay/RelayTestSupport.h"

namespace relay {
namespace {

TEST(ProcessStartTime, IsFieldTwentyTwoWhateverTheCommandName) {
  const std::string fields = " S 1 2 3 4 5 6 7 8 9 10 11 12 13 14 15 16 17 18 987654 20 21\n";
  EXPECT_EQ(parseStartTime("42 (tenond)" + fields), 987654u);
  EXPECT_EQ(parseStartTime("42 (a) b ) (c)" + fields), 987654u);  // names may hold ") "
  EXPECT_FALSE(parseStartTime("42 (x) S 1 2 3").has_value());
  EXPECT_FALSE(parseStartTime("42 (x) S 1 2 3 4 5 6 7 8 9 10 11 12 13 14 15 16 17 18 12ab 20").has_value());
}

// Peers in child processes connect to a listening socket of the test.
class PeerProcessTest : public test::RelayTest {
 protected:
  void SetUp() override {
    address_.sun_family = AF_UNIX;
    (root_.path() + "/peer.sock").copy(address_.sun_path, sizeof address_.sun_path - 1);
    ASSERT_EQ(::bind(listener_.get(), reinterpret_cast<const sockaddr*>(&address_), sizeof address_), 0);
    ASSERT_EQ(::listen(listener_.get(), 4), 0);
  }

  // A child that connects, then exits at once or when the connection
  // closes. It makes only async-signal-safe calls (this process has threads).
  pid_t forkPeer(bool exitAtOnce) {
    const pid_t child = ::fork();
    if (child != 0) return child;
    const int fd = ::socket(AF_UNIX, SOCK_STREAM, 0);
    if (::connect(fd, reinterpret_cast<const sockaddr*>(&address_), sizeof address_) != 0) ::_exit(2);
    char byte;
    while (!exitAtOnce && ::read(fd, &byte, 1) > 0) {
    }
    ::_exit(0);
  }

  UniqueFd accept() { return UniqueFd(::accept4(listener_.get(), nullptr, nullptr, SOCK_CLOEXEC)); }

  static int reap(pid_t child) {
    int status = -1;
    ::waitpid(child, &status, 0);
    return status;
  }

  UniqueFd listener_{::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)};
  sockaddr_un address_{};
};

TEST_F(PeerProcessTest, NamesAChildProcessUntilItIsGone) {
  const pid_t child = forkPeer(false);
  UniqueFd connection = accept();
  tn::Result<PeerIdentity> identity = PeerIdentity::ofSocketPeer(connection.get());
  ASSERT_TRUE(identity.ok()) << identity.error().description();
  const AuditToken token = identity->auditToken;
  EXPECT_EQ(token.pid, child);
  EXPECT_EQ(token.uid, ::getuid());
  EXPECT_EQ(token.gid, ::getgid());
  EXPECT_EQ(token.startTime, processStartTime(child));
  EXPECT_NE(token.pidfd, nullptr);
  EXPECT_TRUE(token.stillSameProcess());
  char self[4096];  // a fork runs the test program's executable
  EXPECT_EQ(identity->executablePath, std::string(self, static_cast<std::size_t>(::readlink("/proc/self/exe", self, sizeof self))));

  AuditToken recycled = token;  // the same pid for a process started at another time
  recycled.startTime += 1;
  recycled.pidfd = nullptr;
  EXPECT_FALSE(recycled.stillSameProcess());

  connection.reset();  // the child sees end of stream and exits
  EXPECT_EQ(reap(child), 0);
  EXPECT_FALSE(token.stillSameProcess());
}

TEST_F(PeerProcessTest, APeerThatIsAlreadyGoneIsNotIdentified) {
  EXPECT_EQ(reap(forkPeer(true)), 0);
  const UniqueFd connection = accept();
  tn::Result<AuditToken> token = AuditToken::ofSocketPeer(connection.get());
  ASSERT_FALSE(token.ok());
  EXPECT_TRUE(isRelayError(token.error(), RelayErrorCode::PeerUnidentified)) << token.error().description();
}

// Peers that set themselves up before connecting (groups, a seccomp filter)
// and, on request, exec another program while connected. The child makes
// only async-signal-safe calls until it execs.
class PeerSetupTest : public PeerProcessTest {
 protected:
  static constexpr gid_t kGroups[] = {4242, 4343};

  void TearDown() override {
    if (go_ >= 0) ::close(go_);
    if (child_ > 0) reap(child_);
  }

  // The child: optional groups and filter, connect, then wait for a byte on
  // the go-ahead pipe; on one, exec /bin/cat on that pipe (which keeps the
  // socket, opened without close-on-exec, and lives until the pipe closes).
  // `execed` gets end of stream once the exec has happened.
  void forkConfiguredPeer(bool withGroups, bool withFilter) {
    int go[2];
    int execed[2];
    ASSERT_EQ(::pipe(go), 0);
    ASSERT_EQ(::pipe2(execed, O_CLOEXEC), 0);
    child_ = ::fork();
    if (child_ == 0) {
      ::close(go[1]);
      ::close(execed[0]);
      if (withGroups && ::setgroups(2, kGroups) != 0) ::_exit(3);
      if (withFilter && !tn::test::installAllowAllFilter()) ::_exit(4);
      const int fd = ::socket(AF_UNIX, SOCK_STREAM, 0);
      if (::connect(fd, reinterpret_cast<const sockaddr*>(&address_), sizeof address_) != 0) ::_exit(2);
      char byte;
      if (::read(go[0], &byte, 1) != 1) ::_exit(0);
      ::dup2(go[0], STDIN_FILENO);
      ::execl("/bin/cat", "cat", static_cast<char*>(nullptr));
      ::_exit(5);
    }
    ::close(go[0]);
    ::close(execed[1]);
    go_ = go[1];
    execed_ = UniqueFd(execed[0]);
  }

  // Lets the child exec and returns once it has.
  void letThePeerExec() {
    ASSERT_EQ(::write(go_, "x", 1), 1);
    char byte;
    ASSERT_EQ(::read(execed_.get(), &byte, 1), 0);
  }

  pid_t child_ = -1;
  int go_ = -1;
  UniqueFd execed_;
};

TEST_F(PeerSetupTest, TheFileTheGroupsAndTheFiltersOfThePeerAreCaptured) {
  if (::geteuid() != 0) GTEST_SKIP() << "setting a child's groups needs root";
  forkConfiguredPeer(true, true);
  const UniqueFd connection = accept();
  tn::Result<PeerIdentity> identity = PeerIdentity::ofSocketPeer(connection.get());
  ASSERT_TRUE(identity.ok()) << identity.error().description();

  struct stat self {};
  ASSERT_EQ(::stat("/proc/self/exe", &self), 0);  // a fork runs the test program
  EXPECT_TRUE(identity->executableKnown);
  EXPECT_EQ(identity->executableDevice, self.st_dev);
  EXPECT_EQ(identity->executableInode, self.st_ino);

  const std::vector<gid_t>& groups = identity->auditToken.groups;
  EXPECT_EQ(groups.size(), 2u);
  EXPECT_NE(std::find(groups.begin(), groups.end(), 4242u), groups.end());
  EXPECT_TRUE(identity->auditToken.isMemberOf(4343));
  EXPECT_TRUE(identity->auditToken.isMemberOf(::getgid()));  // the primary group
  EXPECT_FALSE(identity->auditToken.isMemberOf(4444));

  ASSERT_TRUE(identity->seccompFilters.has_value());
  EXPECT_EQ(*identity->seccompFilters, *sandbox::seccompFilterCount(::getpid()) + 1);
  EXPECT_TRUE(sandbox::countsAsSandboxed(identity->seccompFilters));
}

TEST_F(PeerSetupTest, AnExecAfterConnectingIsSeen) {
  forkConfiguredPeer(false, false);
  const UniqueFd connection = accept();
  tn::Result<PeerIdentity> identity = PeerIdentity::ofSocketPeer(connection.get());
  ASSERT_TRUE(identity.ok()) << identity.error().description();
  EXPECT_FALSE(sandbox::countsAsSandboxed(identity->seccompFilters));
  tn::Result<UniqueFd> before = identity->openRunningExecutable();
  ASSERT_TRUE(before.ok()) << before.error().description();
  EXPECT_TRUE(before->valid());

  letThePeerExec();
  tn::Result<UniqueFd> after = identity->openRunningExecutable();
  ASSERT_FALSE(after.ok());
  EXPECT_NE(after.error().description().find("runs another executable"), std::string::npos)
      << after.error().description();
  EXPECT_EQ(identity->executablePath.find("cat"), std::string::npos) << "the path stays the one of connect time";

  ::close(go_);  // cat sees end of stream and exits
  go_ = -1;
  EXPECT_EQ(reap(child_), 0);
  child_ = -1;
  EXPECT_FALSE(identity->openRunningExecutable().ok()) << "a peer that is gone runs nothing";
}

TEST_F(PeerSetupTest, AnIdentityWithoutItsExecutableNeverOpensOne) {
  forkConfiguredPeer(false, false);
  const UniqueFd connection = accept();
  tn::Result<PeerIdentity> identity = PeerIdentity::ofSocketPeer(connection.get());
  ASSERT_TRUE(identity.ok());
  identity->executableKnown = false;  // as for a peer whose /proc/<pid>/exe could not be opened
  EXPECT_FALSE(identity->openRunningExecutable().ok());
}

}  // namespace
}  // namespace relay
