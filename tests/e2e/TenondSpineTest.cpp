// The daemon's spine, end to end: the real tenond binary on a private
// TENON_ROOT, spoken to over its socket.

#include <gtest/gtest.h>

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <chrono>
#include <cstring>

#include "platform/dispatch/Semaphore.h"
#include "platform/relay/Connection.h"
#include "platform/relay/ServicePath.h"
#include "platform/value/Cbor.h"
#include "platform/notify/Post.h"
#include "tests/platform/bundle/BundleTestSupport.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/RelayPeer.h"
#include "tests/support/Subprocess.h"

namespace tn::test {
namespace {

const std::string kTenond = tenondBinaryPath();

// The daemon under test. This process's own connections look for its
// service under the daemon's root.
class TenondProcess : public DaemonProcess {
 public:
  explicit TenondProcess(std::vector<std::string> arguments = {}) : DaemonProcess(kTenond, std::move(arguments)) {
    setenv("TENON_ROOT", root().c_str(), 1);
  }
};

// How often the annotation-change notification was posted under `root`.
uint64_t annotationChangeCount(const std::string& root) {
  setenv("TENON_ROOT", root.c_str(), 1);
  auto count = notify::postCount("com.ostrel.tenon.annotation-change");
  return count ? *count : 0;
}

using Client = RelayPeer;

void expectError(const Value& reply, uint64_t code, const std::string& message) {
  EXPECT_EQ(reply["errorcode"], Value(code)) << reply.description();
  EXPECT_EQ(reply["error"], Value(message)) << reply.description();
}

TEST(TenondCommandLine, UsageErrorsPrintTheExactUsageLineAndExitWithStatus2) {
  for (const std::vector<std::string>& args :
       {std::vector<std::string>{"-x"}, {"extra-operand"}, {"-S"}, {"-c"}, {"-S", "a", "b"}}) {
    std::vector<std::string> argv{kTenond};
    argv.insert(argv.end(), args.begin(), args.end());
    const ProcessResult r = runProcess(argv, {"TENON_ROOT=/nonexistent-root", "TENON_LOG=debug"});
    EXPECT_EQ(r.exitStatus, 2) << args[0];
    // Nothing but the launch line is logged before the usage line.
    EXPECT_NE(r.err.find("Usage: tenond [-S servicename] [-v]\n"), std::string::npos) << r.err;
    EXPECT_EQ(r.err.find("error"), std::string::npos) << r.err;
  }
}

TEST(TenondCommandLine, AnUnusableDatabasePathMeansExitStatus1) {
  TempDirectory root;
  const ProcessResult r = runProcess({kTenond, "-S", "unused.service", "-d", "/dev/null/annotations"},
                                     {"TENON_ROOT=" + root.path()});
  EXPECT_EQ(r.exitStatus, 1);
  EXPECT_NE(r.err.find("unable to construct server"), std::string::npos) << r.err;
}

TEST(TenondCommandLine, OptionsAreReadLikeTheStandardParserAndAtoiRead) {
  TenondProcess daemon({"-v", "-c", "12abc", "-v", "-d", "annotations-here"});
  ASSERT_TRUE(daemon.accepting()) << daemon.log();
  const std::string log = daemon.log();
  const std::string verbose = "verbose option -v is ineffective; use log config --subsystem com.ostrel.tenon";
  const size_t first = log.find(verbose);
  ASSERT_NE(first, std::string::npos) << log;
  EXPECT_NE(log.find(verbose, first + 1), std::string::npos) << "two -v, two lines";
  EXPECT_NE(log.find("with cache limit 12, annotation file annotations-here"), std::string::npos) << log;
  EXPECT_EQ(daemon.terminate(), 0);

  TenondProcess letters({"-c", "abc", "-c", "-5"});
  ASSERT_TRUE(letters.accepting());
  // The later -c wins; a negative limit wraps to a large unsigned one.
  EXPECT_NE(letters.log().find("with cache limit 4294967291"), std::string::npos) << letters.log();
}

TEST(TenondLifecycle, SigtermExitsZeroAndPostsExactlyOneAnnotationChange) {
  TenondProcess daemon;
  ASSERT_TRUE(daemon.accepting()) << daemon.log();
  const uint64_t before = annotationChangeCount(daemon.root());
  EXPECT_EQ(daemon.terminate(), 0);
  EXPECT_EQ(annotationChangeCount(daemon.root()), before + 1);
  EXPECT_NE(daemon.log().find("tenond is launching"), std::string::npos);
}

TEST(TenondEnvelope, VersionIsTestedFirstAndReportedExactly) {
  TenondProcess daemon;
  ASSERT_TRUE(daemon.accepting()) << daemon.log();
  Client client(daemon.service());
  ASSERT_TRUE(client.connected());
  expectError(client.request({{"request", "match"}}), 7, "unsupported protocol version 0 (current 3)");
  expectError(client.request({{"request", "match"}, {"version", 1u}}), 7, "unsupported protocol version 1 (current 3)");
  expectError(client.request({{"version", 4u}}), 7, "unsupported protocol version 4 (current 3)");
  // A version of another kind counts as absent.
  expectError(client.request({{"request", "match"}, {"version", "3"}}), 7, "unsupported protocol version 0 (current 3)");
}

TEST(TenondEnvelope, MissingNumericUnknownAndMiscasedTypes) {
  TenondProcess daemon;
  ASSERT_TRUE(daemon.accepting()) << daemon.log();
  Client client(daemon.service());
  expectError(client.request({{"version", 3u}}), 4, "invalid request format (missing type)");
  expectError(client.request({{"version", 2u}, {"request", 7u}}), 4, "invalid request format (missing type)");
  expectError(client.request({{"version", 3u}, {"request", "frobnicate"}}), 4, "unrecognized request");
  expectError(client.request({{"version", 3u}, {"request", "Match"}}), 4, "unrecognized request");
  const std::string log = daemon.log();
  EXPECT_NE(log.find("requested (null)"), std::string::npos) << log;
  EXPECT_NE(log.find("requested frobnicate"), std::string::npos) << log;
}

TEST(TenondEnvelope, RequestsOfOneConnectionAreAnsweredInOrderAndCountedPerThousand) {
  TenondProcess daemon;
  ASSERT_TRUE(daemon.accepting()) << daemon.log();
  Client client(daemon.service());
  // Fire 999 requests without waiting; the replies must come back in order.
  auto queue = dispatch::SerialQueue::create("order");
  std::vector<uint64_t> versions;
  dispatch::Semaphore all;
  for (uint64_t i = 0; i < 999; ++i) {
    client.connection()->sendWithReply(Value(Dictionary{{"version", 1000 + i}}), queue, [&, i](relay::Reply r) {
      versions.push_back(i);
      EXPECT_TRUE(r);
      if (versions.size() == 999) all.signal();
    });
  }
  ASSERT_TRUE(all.waitFor(std::chrono::seconds(20)));
  for (uint64_t i = 0; i < versions.size(); ++i) ASSERT_EQ(versions[i], i);
  const std::string line = "client " + std::to_string(getpid()) + " used 1000 requests so far";
  EXPECT_EQ(daemon.log().find(line), std::string::npos) << "logged at the 999th";
  client.request({{"version", 3u}});
  EXPECT_NE(daemon.log().find(line), std::string::npos) << daemon.log().substr(0, 2000);
}

// A raw socket for breaking the protocol on purpose.
int rawConnect(const std::string& service) {
  const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  const std::string path = *relay::servicePath(service);
  std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
  if (connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) return -1;
  return fd;
}

void writeFrame(int fd, uint32_t length, uint64_t id, const Bytes& body) {
  Bytes frame;
  for (int i = 3; i >= 0; --i) frame.push_back(static_cast<uint8_t>(length >> (8 * i)));
  for (int i = 7; i >= 0; --i) frame.push_back(static_cast<uint8_t>(id >> (8 * i)));
  for (int i = 0; i < 8; ++i) frame.push_back(0);
  frame.insert(frame.end(), body.begin(), body.end());
  ASSERT_EQ(write(fd, frame.data(), frame.size()), static_cast<ssize_t>(frame.size()));
}

// True when the daemon closed the socket (read sees end of file or reset).
bool closedByPeer(int fd) {
  timeval timeout{5, 0};
  setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout);
  char buffer[256];
  for (;;) {
    const ssize_t n = read(fd, buffer, sizeof buffer);
    if (n == 0 || (n < 0 && errno == ECONNRESET)) return true;
    if (n < 0) return false;  // timed out: still open
  }
}

TEST(TenondProtocolViolations, EachClosesOnlyTheOffendingConnection) {
  TenondProcess daemon;
  ASSERT_TRUE(daemon.accepting()) << daemon.log();
  Client bystander(daemon.service());
  ASSERT_TRUE(bystander.connected());

  Bytes deep;
  deep.push_back(0xA1);  // {"a": [[[[...]]]]} nested 70 deep
  deep.push_back(0x61);
  deep.push_back('a');
  for (int i = 0; i < 70; ++i) deep.push_back(0x81);
  deep.push_back(0x00);

  struct Case {
    const char* name;
    uint32_t length;
    Bytes body;
  };
  const std::vector<Case> cases{
      {"oversize length", 16u * 1024 * 1024 + 17, {}},
      {"bad CBOR", 16 + 3, {0xA1, 0x61, 0xFF}},
      {"excessive nesting", static_cast<uint32_t>(16 + deep.size()), deep},
      {"body not a map", 16 + 1, {0x01}},
  };
  for (const Case& c : cases) {
    const int fd = rawConnect(daemon.service());
    ASSERT_GE(fd, 0) << c.name;
    writeFrame(fd, c.length, 1, c.body);
    EXPECT_TRUE(closedByPeer(fd)) << c.name;
    close(fd);
    // The daemon is alive and the other client is still served.
    expectError(bystander.request({{"version", 3u}, {"request", "nope"}}), 4, "unrecognized request");
  }
  EXPECT_EQ(daemon.terminate(), 0);
}

}  // namespace
}  // namespace tn::test
