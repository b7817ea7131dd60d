// Hostile peers against the real tenond: a peer holding locks on the
// notification files cannot stop SIGTERM, a manifest cannot get tokens for
// files outside its bundle, paths with a NUL name nothing, and a peer's text
// can neither forge nor flood the daemon's log.

#include <gtest/gtest.h>

#include <fcntl.h>
#include <grp.h>
#include <sys/file.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <thread>

#include "platform/dispatch/Semaphore.h"
#include "platform/dispatch/SerialQueue.h"
#include "platform/notify/Post.h"
#include "platform/relay/Connection.h"
#include "platform/value/Document.h"
#include "tests/platform/bundle/BundleTestSupport.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/RelayPeer.h"
#include "tests/support/Subprocess.h"

namespace tn::test {
namespace {

using namespace std::string_literals;

const std::string kTnctl = std::string(TENON_BINARY_DIR "/tools/tnctl/tnctl");
constexpr std::string_view kAnnotationChange = "com.ostrel.tenon.annotation-change";

using Peer = RelayPeer;

Dictionary pathRequest(const std::string& type, const std::string& path) {
  return Dictionary{{"request", Value(type)}, {"version", Value(3)}, {"paths", Value(Array{Value(path)})}};
}

class HostileInput : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(daemon_.accepting()) << daemon_.log();
    ::setenv("TENON_ROOT", daemon_.root().c_str(), 1);  // where this process finds the service
  }
  void TearDown() override { ::unsetenv("TENON_ROOT"); }

  ProcessResult tnctl(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), kTnctl);
    arguments.insert(arguments.end(), {"--service", daemon_.service()});
    return runProcess(arguments, daemon_.environment());
  }

  // Waits (bounded) until the daemon's log holds text.
  bool daemonLogs(const std::string& text) {
    for (int i = 0; i < 500; ++i) {
      if (daemon_.log().find(text) != std::string::npos) return true;
      std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    return false;
  }

  // The daemon's log lines that contain text.
  std::vector<std::string> logLines(const std::string& text) {
    std::vector<std::string> found;
    std::istringstream lines(daemon_.log());
    for (std::string line; std::getline(lines, line);)
      if (line.find(text) != std::string::npos) found.push_back(line);
    return found;
  }

  // The plug-in's UUID once the registrar lists it ("" until then).
  std::string registered(const std::string& bundle) {
    const auto shown = tnctl({"--json", "registry", "show", bundle});
    if (shown.exitStatus != 0) return "";
    const auto document = readDocument(shown.out, "registry show", DocumentEncoding::Json);
    const std::string* uuid = document.ok() ? (*document)["uuid"].string() : nullptr;
    return uuid ? *uuid : "";
  }

  DaemonProcess daemon_{tenondBinaryPath()};
};

// flock needs only read access, and every user may read the notification
// files: a peer of another user holding every file it can open there must
// not keep SIGTERM from releasing the holds, posting once and exiting 0.
TEST_F(HostileInput, SigtermEndsTheDaemonWhileAPeerLocksEveryNotificationFile) {
  ASSERT_TRUE(notify::post(kAnnotationChange));  // the file exists, as after any earlier hold change
  const uint64_t before = *notify::postCount(kAnnotationChange);
  // The peer is another user: it must reach the directory (the private
  // root's mode depends on the umask).
  std::filesystem::permissions(daemon_.root(), std::filesystem::perms(0755));
  int ready[2];
  int release[2];
  ASSERT_EQ(::pipe(ready), 0);
  ASSERT_EQ(::pipe(release), 0);
  const pid_t peer = ::fork();
  if (peer == 0) {
    ::close(ready[0]);
    ::close(release[1]);
    if (::setgroups(0, nullptr) != 0 || ::setgid(65534) != 0 || ::setuid(65534) != 0) ::_exit(2);
    int locked = 0;
    for (const auto& entry : std::filesystem::directory_iterator(daemon_.root() + "/run/tenon/notify")) {
      const int fd = ::open(entry.path().c_str(), O_RDONLY | O_CLOEXEC);  // kept open: the lock stays
      if (fd >= 0 && ::flock(fd, LOCK_EX) == 0) ++locked;
    }
    const char count = static_cast<char>(locked);
    (void)!::write(ready[1], &count, 1);
    char ignored;
    (void)!::read(release[0], &ignored, 1);  // until the parent closes its end
    ::_exit(0);
  }
  ::close(ready[1]);
  ::close(release[0]);
  char locked = 0;
  ASSERT_EQ(::read(ready[0], &locked, 1), 1);
  EXPECT_GE(locked, 1);

  EXPECT_EQ(daemon_.terminate(), 0) << daemon_.log();
  ::close(release[1]);
  ::close(ready[0]);
  int status = 0;
  ASSERT_EQ(::waitpid(peer, &status, 0), peer);
  EXPECT_EQ(*notify::postCount(kAnnotationChange), before + 1) << "stop posts exactly one";
}

// A manifest names what it shares; the daemon gives tokens only for what
// lies inside the bundle.
TEST_F(HostileInput, FindGivesNoTokenForResourcesOutsideTheBundle) {
  const std::string staging = daemon_.root() + "/Messenger";
  std::filesystem::copy(std::string(TENON_SOURCE_DIR "/examples/applications/Messenger"), staging,
                        std::filesystem::copy_options::recursive);
  const std::string inStaging = staging + "/Support/PlugIns/ShareToChat";
  std::string manifest;
  {
    std::ifstream in(inStaging + "/Info.manifest");
    manifest.assign(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
  }
  const std::string marker = R"("XTExtension": {)";
  ASSERT_NE(manifest.find(marker), std::string::npos);
  manifest.insert(manifest.find(marker) + marker.size(),
                  R"("Shared": ["../", "/etc/passwd", "Root", "Inside", "Shared/../../.."],)");
  std::ofstream(inStaging + "/Info.manifest", std::ofstream::trunc) << manifest;
  makeDirectory(inStaging + "/Shared");
  std::filesystem::create_symlink("/", inStaging + "/Root");
  std::filesystem::create_symlink("Shared", inStaging + "/Inside");
  const std::string application = daemon_.root() + "/opt/tenon/applications/Messenger";
  std::filesystem::rename(staging, application);
  const std::string plugIn = application + "/Support/PlugIns/ShareToChat";
  for (int i = 0; i < 500 && registered(plugIn).empty(); ++i) std::this_thread::sleep_for(std::chrono::milliseconds(20));
  ASSERT_FALSE(registered(plugIn).empty()) << daemon_.log();

  const auto found = tnctl({"--json", "find", "--url", "file://" + plugIn});
  ASSERT_EQ(found.exitStatus, 0) << found.err;
  const auto document = readDocument(found.out, "find", DocumentEncoding::Json);
  ASSERT_TRUE(document.ok()) << found.out;
  const Value extensions = (*document)["matches"]["extensions"];
  ASSERT_TRUE(extensions.isDictionary()) << found.out;
  EXPECT_EQ(extensions.dictionary()->size(), 1u) << found.out;
  EXPECT_TRUE(extensions["Inside"].string()) << "a link that stays inside gets its token";
  for (const std::string resource : {"../", "/etc/passwd", "Root", "Shared/../../.."}) {
    EXPECT_TRUE(extensions[resource].isNull()) << resource;
    EXPECT_TRUE(daemonLogs("refusing extension for resource " + resource + " of plug-in at " + plugIn)) << resource;
  }
}

// A NUL ends a path for the file system, so a path holding one names
// nothing: never the part before it.
TEST_F(HostileInput, PathsWithANulNameNothing) {
  const std::string bundle = daemon_.root() + "/System/Library/PlugIns/Real.tnx";
  makeBundle(bundle, R"({"BNBundleIdentifier": "com.example.real", "BNBundleVersion": "1",
      "XTExtension": {"XTExtensionPointIdentifier": "com.example.thumbnails",
                      "XTExtensionProtocol": "com.example.protocol", "XTExtensionAttributes": {"Kind": "thumb"}}})");
  const auto installed =
      runProcess({std::string(TENON_SOURCE_DIR "/scripts/install-entitlements"), daemon_.root(), kTnctl});
  ASSERT_EQ(installed.exitStatus, 0) << installed.err;
  ASSERT_EQ(tnctl({"add", bundle}).exitStatus, 0);
  ASSERT_FALSE(registered(bundle).empty());

  Peer peer(daemon_.service());
  ASSERT_TRUE(peer.connected());
  const Value added = peer.request(pathRequest("add", bundle + "\0/x"s));
  EXPECT_EQ(added["errorcode"], Value(9)) << added.description();
  EXPECT_EQ(added["error"], Value("invalid plugin path: " + bundle + "\\x00/x")) << "escaped, not cut";

  // "remove" by a manager: refused before the registrar, the plug-in stays.
  const auto removed = tnctl({"request", R"({"request":"remove","version":3,"paths":[")" + bundle + R"(\u0000"]})"});
  EXPECT_EQ(removed.exitStatus, 1);
  EXPECT_EQ(removed.err, "tnctl: error 9: no plugin at " + bundle + "\\x00\n");
  EXPECT_FALSE(registered(bundle).empty()) << "still registered";

  // A hold on a path with a NUL holds nothing.
  Dictionary hold = pathRequest("lock", bundle + "\0"s);
  hold.set("flags", 1);
  const Value held = peer.request(hold);
  EXPECT_EQ(held["errorcode"], Value(9)) << held.description();
  EXPECT_EQ(held["error"], Value("invalid path: " + bundle + "\\x00"));

  for (const std::string& url : {"file://" + bundle + "\0"s, "file://" + bundle + "\0/../Real.tnx"s}) {
    const Value found = peer.request(Dictionary{{"request", Value("find")}, {"version", Value(3)},
                                                {"paths", Value(url)}});
    EXPECT_EQ(found["errorcode"], Value(15)) << found.description();
    EXPECT_EQ(found["error"], Value("Cannot locate PlugIn"));
  }
}

// Control characters in what a peer sends reach the log escaped, so they
// cannot move the cursor, retitle a terminal or start a forged line.
TEST_F(HostileInput, APeersTextIsEscapedInTheLog) {
  const std::string evil = daemon_.root() + "/System/Evil\x1b[31m.tnx";
  makeDirectory(evil);  // not a bundle: the registrar refuses it, and the daemon says so
  Peer peer(daemon_.service());
  ASSERT_TRUE(peer.connected());
  EXPECT_EQ(peer.request(pathRequest("add", evil))["errorcode"], Value(2));
  EXPECT_TRUE(daemonLogs("failed to register plug-in at " + daemon_.root() + "/System/Evil\\x1b[31m.tnx"))
      << daemon_.log();

  const std::string forged = "/opt/\x1b]0;owned\x07\x1b[2J\nFAKE tenond[1] ops.error: \xc2\x9b forged";
  EXPECT_EQ(peer.request(pathRequest("remove", forged))["errorcode"], Value(11));
  EXPECT_TRUE(daemonLogs(R"(to remove plug-in at /opt/\x1b]0;owned\x07\x1b[2J\nFAKE tenond[1] ops.error: \u009b forged)"))
      << daemon_.log();
  EXPECT_EQ(daemon_.log().find('\x1b'), std::string::npos) << "no raw escape character anywhere";
  for (const std::string& line : logLines("FAKE"))
    EXPECT_NE(line.find("to remove plug-in at"), std::string::npos) << "a line of its own: " << line;
}

// Thousands of identical failing requests from one client: a bounded number
// of lines, then a summary that accounts for every line not written.
TEST_F(HostileInput, AFloodOfFailingRequestsIsBoundedAndSummarised) {
  constexpr int kRequests = 3000;
  Peer peer(daemon_.service());
  ASSERT_TRUE(peer.connected());
  const std::string refused = "to remove plug-in at /flood - client lacks required entitlement";
  const auto began = std::chrono::steady_clock::now();
  for (int i = 0; i < kRequests; ++i) ASSERT_EQ(peer.request(pathRequest("remove", "/flood"))["errorcode"], Value(11));

  // Lines suppressed since the last written one are summarised with the
  // next line the client is allowed: keep asking (bounded) until every
  // request is accounted for, as a line or in a summary.
  const std::string summary = "default.default: \u2026 ";
  const auto account = [&] {
    uint64_t suppressed = 0;
    for (const std::string& line : logLines(summary)) {
      unsigned long long n = 0;
      if (std::sscanf(line.c_str() + line.find(summary) + summary.size(), "%llu similar lines suppressed", &n) == 1)
        suppressed += n;
    }
    return std::make_pair(logLines(refused).size(), suppressed);
  };
  int sent = kRequests;
  for (int i = 0; i < 200; ++i, ++sent) {
    const auto [written, suppressed] = account();
    if (written + suppressed == static_cast<uint64_t>(sent)) break;
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
    ASSERT_EQ(peer.request(pathRequest("remove", "/flood"))["errorcode"], Value(11));
  }
  const double elapsed = std::chrono::duration<double>(std::chrono::steady_clock::now() - began).count();
  const auto [written, suppressed] = account();
  EXPECT_EQ(written + suppressed, static_cast<uint64_t>(sent)) << "every request is a line or counted";
  EXPECT_FALSE(logLines(summary).empty());
  EXPECT_LE(written, static_cast<size_t>(20 + 10 * elapsed + 2)) << "in " << elapsed << " s";
  EXPECT_GE(suppressed, static_cast<uint64_t>(kRequests / 2));
}

}  // namespace
}  // namespace tn::test
