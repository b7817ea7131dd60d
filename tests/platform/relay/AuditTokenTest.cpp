#include "platform/relay/AuditToken.h"

#include <gtest/gtest.h>

#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include "platform/relay/PeerIdentity.h"
#include "platform/relay/ProcessStartTime.h"
#include "platform/relay/RelayError.h"
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

}  // namespace
}  // namespace relay
