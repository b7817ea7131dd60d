// The supervisor in the real tenond: a host process (warden_host) starts the
// example plug-in (upcase) through the supervisor's service and talks to it
// over the socket it got in the reply. The registration is made through the
// service's test-only "register" request, as the daemon makes it when a host
// readies plug-ins. When the test runs as root, the host runs as uid 65534.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <future>
#include <memory>
#include <optional>
#include <string>
#include <thread>

#include "platform/dispatch/SerialQueue.h"
#include "platform/relay/Connection.h"
#include "platform/sandbox/SandboxCheck.h"
#include "tests/e2e/AnnotationTestSupport.h"
#include "tests/e2e/WardenTestSupport.h"
#include "tests/platform/bundle/BundleTestSupport.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/Subprocess.h"
#include "tests/support/TrustedInstall.h"

namespace {

namespace fs = std::filesystem;
using tn::test::ChildProcess;
using tn::test::DaemonProcess;
using namespace tn::test::warden_support;

tn::Value overlay() {
  return tn::Dictionary{
      {"RelayService", tn::Dictionary{{"EnvironmentVariables", tn::Dictionary{{"GREETING", "hello"}}},
                                      {"_SandboxProfile", "plugin"},
                                      {"_OmitSandboxParameters", true}}},
      {"BNBundlePackageType", "RLY!"}};
}

class WardenTest : public ::testing::Test {
 protected:
  WardenTest()
      : hostUid_(::geteuid() == 0 ? kNobody : ::geteuid()),
        daemon_(tn::test::tenondBinaryPath(), {}, [this](const std::string& root) { prepareRoot(root, hostUid_); },
                {"TENON_WARDEN_TEST_HOOKS=1"}) {
    ::setenv("TENON_ROOT", daemon_.root().c_str(), 1);
  }
  ~WardenTest() override { ::unsetenv("TENON_ROOT"); }

  std::string executable() const { return daemon_.root() + "/opt/plugins/Upcase.bundle/bin/upcase"; }
  std::string container() const { return daemon_.root() + "/var/lib/tenon/containers/" + kPlugIn; }

  tn::Value registerFor(pid_t host, const std::string& program = "") {
    return ask("com.ostrel.tenon.warden", tn::Dictionary{{"request", "register"},
                                                         {"host", host},
                                                         {"executable", program.empty() ? executable() : program},
                                                         {"overlay", overlay()}});
  }

  tn::Value busy() {
    return ask("com.ostrel.tenon.vigil",
               tn::Dictionary{{"request", "busy-instances"}, {"identifiers", tn::Array{tn::Value(kPlugIn)}}});
  }

  const uid_t hostUid_;
  DaemonProcess daemon_;
};

TEST_F(WardenTest, StartedPlugInAnswersAsTheHostsUserInItsSandbox) {
  ASSERT_TRUE(daemon_.accepting()) << daemon_.log();
  Host host(daemon_.root(), hostUid_);
  ASSERT_EQ(registerFor(host.pid()), tn::Value(tn::Dictionary{})) << daemon_.log();

  const pid_t plugIn = startedPid(host.command(std::string("start ") + kPlugIn));
  ASSERT_GT(plugIn, 0) << daemon_.log();
  EXPECT_EQ(host.command("send make this loud"), "MAKE THIS LOUD");
  EXPECT_EQ(host.command("send whoami").substr(0, 4 + std::to_string(hostUid_).size()),
            "uid=" + std::to_string(hostUid_));
  // The daemon's own test sees it as sandboxed.
  EXPECT_TRUE(sandbox::isProcessSandboxed(plugIn));
  // Exactly the overlay's environment, with the socket and the root added.
  EXPECT_EQ(host.command("send env"),
            "GREETING=hello TENON_PLUGIN_SOCKET=3 TENON_ROOT=" + daemon_.root());
  EXPECT_EQ(host.command("send write " + container() + "/note"), "ok");
}

TEST_F(WardenTest, StartedPlugInCannotWriteOutsideItsContainer) {
  ASSERT_TRUE(daemon_.accepting()) << daemon_.log();
  const long abi = ::syscall(SYS_landlock_create_ruleset, nullptr, 0, 1U);
  if (abi <= 0) GTEST_SKIP() << "this kernel has no Landlock; plug-ins are confined by seccomp only";
  // A directory the host's user may write to, so that only the sandbox stops it.
  const std::string open = daemon_.root() + "/open";
  fs::create_directories(open);
  fs::permissions(open, fs::perms(0777));
  Host host(daemon_.root(), hostUid_);
  ASSERT_EQ(registerFor(host.pid()), tn::Value(tn::Dictionary{}));
  ASSERT_GT(startedPid(host.command(std::string("start ") + kPlugIn)), 0) << daemon_.log();
  EXPECT_EQ(host.command("send write " + open + "/escape").rfind("refused", 0), 0u);
  EXPECT_FALSE(fs::exists(open + "/escape"));
}

TEST_F(WardenTest, BusyDeclarationsAreSeenUntilTheInstanceIsIdle) {
  ASSERT_TRUE(daemon_.accepting()) << daemon_.log();
  Host host(daemon_.root(), hostUid_);
  ASSERT_EQ(registerFor(host.pid()), tn::Value(tn::Dictionary{}));
  const pid_t plugIn = startedPid(host.command(std::string("start ") + kPlugIn));
  ASSERT_GT(plugIn, 0) << daemon_.log();
  EXPECT_EQ(busy()["instances"], tn::Value(tn::Array{}));
  ASSERT_EQ(host.command("send hold"), "busy") << daemon_.log();
  const tn::Value busyNow = busy()["instances"];
  ASSERT_TRUE(busyNow.array() && busyNow.array()->size() == 1) << busyNow;
  EXPECT_EQ((*busyNow.array())[0]["BNBundleIdentifier"], tn::Value(kPlugIn));
  EXPECT_EQ((*busyNow.array())[0]["pid"], tn::Value(plugIn));
  ASSERT_EQ(host.command("send release"), "idle");
  EXPECT_EQ(busy()["instances"], tn::Value(tn::Array{}));
}

// The Python side: examples/python/upcase_plugin.py with the example client
// beside it, started like any plug-in, declares itself busy and idle.
TEST_F(WardenTest, APythonPlugInDeclaresItselfBusyThroughTheExampleClient) {
  ASSERT_TRUE(daemon_.accepting()) << daemon_.log();
  const fs::path bundle = fs::path(daemon_.root()) / "opt/plugins/PyUpcase.bundle";
  tn::test::makeBundle(bundle.string(), R"({"BNBundleIdentifier": "com.example.pyupcase", "BNBundleVersion": "1.0",
                                           "BNBundleExecutable": "upcase_plugin.py"})");
  install(TENON_SOURCE_DIR "/examples/python/upcase_plugin.py", bundle / "bin/upcase_plugin.py", fs::perms(0755));
  install(TENON_SOURCE_DIR "/examples/python/tenon_client.py", bundle / "bin/tenon_client.py", fs::perms(0644));
  const fs::path container = fs::path(daemon_.root()) / "var/lib/tenon/containers/com.example.pyupcase";
  fs::create_directories(container);
  openDirectories(daemon_.root());
  ASSERT_EQ(::chown(container.c_str(), hostUid_, hostUid_), 0);

  Host host(daemon_.root(), hostUid_);
  ASSERT_EQ(registerFor(host.pid(), (bundle / "bin/upcase_plugin.py").string()), tn::Value(tn::Dictionary{}));
  ASSERT_GT(startedPid(host.command("start com.example.pyupcase")), 0) << daemon_.log();
  EXPECT_EQ(host.command("send from python"), "FROM PYTHON") << daemon_.log();
  ASSERT_EQ(host.command("send hold"), "busy") << daemon_.log();
  const tn::Value busyNow = ask("com.ostrel.tenon.vigil", tn::Dictionary{{"request", "busy-instances"},
                                                                         {"identifiers", tn::Array{tn::Value(
                                                                                             "com.example.pyupcase")}}});
  ASSERT_TRUE(busyNow["instances"].array() && busyNow["instances"].array()->size() == 1) << busyNow;
  EXPECT_EQ(host.command("send release"), "idle");
}

TEST_F(WardenTest, HostsStartOnlyWhatWasRegisteredForThemAndRegistrationsEndWithThem) {
  ASSERT_TRUE(daemon_.accepting()) << daemon_.log();
  Host host(daemon_.root(), hostUid_);
  EXPECT_EQ(host.command(std::string("start ") + kPlugIn).rfind("error 1 no plug-in", 0), 0u);
  ASSERT_EQ(registerFor(host.pid()), tn::Value(tn::Dictionary{}));
  EXPECT_EQ(host.command("start /bin/sh").rfind("error 1 ", 0), 0u);  // not registered: never run
  const tn::Value listed = ask("com.ostrel.tenon.warden", tn::Dictionary{{"request", "list"}})["registrations"];
  ASSERT_TRUE(listed.array() && listed.array()->size() == 1) << listed;
  EXPECT_EQ((*listed.array())[0]["host"], tn::Value(host.pid()));
  const auto shown = tn::test::runProcess({TENON_BINARY_DIR "/tools/tnctl/tnctl", "warden", "list"},
                                          daemon_.environment());
  EXPECT_EQ(shown.exitStatus, 0) << shown.err;
  EXPECT_NE(shown.out.find("registrations: 1\n  host " + std::to_string(host.pid()) + "  com.example.upcase 1.0"),
            std::string::npos)
      << shown.out;

  EXPECT_EQ(host.command("exit"), "bye");
  host.finish();
  // The registration goes when the supervisor sees the host's pidfd report
  // the exit; the daemon logs it.
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
  while (daemon_.log().find("registrations go with it") == std::string::npos &&
         std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  const tn::Value after = ask("com.ostrel.tenon.warden", tn::Dictionary{{"request", "list"}})["registrations"];
  EXPECT_EQ(after, tn::Value(tn::Array{})) << daemon_.log();
}

// "ready" end to end: the daemon registers what a host readies with the
// real supervisor, so that the host can then start it; every named plug-in
// is checked before any is enabled.
const std::string kApplication = "opt/tenon/applications/TextTools";

void prepareApplication(const std::string& root, uid_t hostUid) {
  prepareRoot(root, hostUid);
  const fs::path app = fs::path(root) / kApplication;
  tn::test::makeBundle(app.string(), R"({"BNBundleIdentifier": "com.example.texttools"})");
  const fs::path upcase = app / "Support/PlugIns/Upcase.tnx";
  install(TENON_SOURCE_DIR "/examples/plugins/Upcase.bundle/Info.manifest", upcase / "Info.manifest", fs::perms(0644));
  install(TENON_BINARY_DIR "/examples/plugins/upcase/upcase", upcase / "bin/upcase", fs::perms(0755));
  tn::test::makeBundle((app / "Support/PlugIns/Words.tnx").string(), R"({"BNBundleIdentifier": "com.example.words",
      "XTExtension": {"XTExtensionPointIdentifier": "com.example.text-service", "XTExtensionProtocol": "#Data",
                      "XTExtensionAttributes": {}}})");
  tn::test::makeBundle((app / "Support/PlugIns/Demanding.tnx").string(), R"({"BNBundleIdentifier": "com.example.demanding",
      "BNBundleExecutable": "upcase",
      "XTExtension": {"XTExtensionPointIdentifier": "com.example.text-service",
                      "XTExtensionHostEntitlement": "com.example.host", "XTExtensionAttributes": {}}})");
  openDirectories(root);
}

class Readiness : public ::testing::Test {
 protected:
  Readiness()
      : hostUid_(::geteuid() == 0 ? kNobody : ::geteuid()),
        daemon_(tn::test::tenondBinaryPath(), {},
                [this](const std::string& root) { prepareApplication(root, hostUid_); }) {
    ::setenv("TENON_ROOT", daemon_.root().c_str(), 1);
  }
  ~Readiness() override { ::unsetenv("TENON_ROOT"); }

  tn::UUID uuidOf(const std::string& bundle) {
    return tn::test::registeredUUID(daemon_.root(), daemon_.root() + "/" + kApplication + "/Support/PlugIns/" + bundle);
  }
  tn::Value ready(tn::Array uuids, std::optional<tn::Value> environment = std::nullopt) {
    tn::Dictionary request{{"request", "ready"}, {"version", 3}, {"uuids", tn::Value(std::move(uuids))}};
    if (environment) request.set("environment", *environment);
    return ask(daemon_.service(), std::move(request));
  }
  // This test program's registrations with the supervisor.
  tn::Value registrations() {
    return ask("com.ostrel.tenon.warden", tn::Dictionary{{"request", "list"}})["registrations"];
  }

  const uid_t hostUid_;
  DaemonProcess daemon_;
};

TEST_F(Readiness, AReadiedPlugInStartsForItsHostWithTheMergedEnvironment) {
  ASSERT_TRUE(daemon_.accepting()) << daemon_.log();
  const tn::UUID upcase = uuidOf("Upcase.tnx");
  ASSERT_FALSE(upcase.isNil()) << daemon_.log();
  Host host(daemon_.root(), hostUid_);
  EXPECT_EQ(host.command(std::string("start ") + kPlugIn).rfind("error 1 ", 0), 0u) << "not readied yet";
  ASSERT_EQ(host.command("ready " + daemon_.service() + " " + upcase.string()), "ready") << daemon_.log();
  ASSERT_GT(startedPid(host.command(std::string("start ") + kPlugIn)), 0) << daemon_.log();
  EXPECT_EQ(host.command("send ready and running"), "READY AND RUNNING");
  const std::string environment = host.command("send env");
  const std::string container = daemon_.root() + "/var/lib/tenon/containers/" + kPlugIn;
  for (const std::string& expected : {"HOME=" + container, "BNFIXED_USER_HOME=" + container,
                                      "TMPDIR=" + container + "/tmp", std::string("TENON_PLUGIN_SOCKET=3")}) {
    EXPECT_NE(environment.find(expected), std::string::npos) << expected << " in " << environment;
  }
  EXPECT_NE(daemon_.log().find("assigning plug-in com.example.upcase"), std::string::npos);
}

TEST_F(Readiness, EveryPlugInIsCheckedBeforeAnyIsEnabled) {
  ASSERT_TRUE(daemon_.accepting()) << daemon_.log();
  const tn::UUID upcase = uuidOf("Upcase.tnx");
  const tn::UUID words = uuidOf("Words.tnx");
  const tn::UUID demanding = uuidOf("Demanding.tnx");
  ASSERT_FALSE(upcase.isNil() || words.isNil() || demanding.isNil()) << daemon_.log();

  // The second is refused: the first is not enabled either.
  const tn::Value refused = ready({tn::Value(upcase), tn::Value(demanding)});
  EXPECT_EQ(refused["errorcode"], tn::Value(uint64_t{11})) << refused;
  EXPECT_EQ(refused["error"], tn::Value("access to plugin com.example.demanding denied: the host does not have the "
                                        "\"com.example.host\" entitlement"));
  EXPECT_EQ(registrations(), tn::Value(tn::Array{}));

  // An environment, even empty, needs the entitlement; a number is no
  // environment at all.
  const tn::Value empty = ready({tn::Value(upcase)}, tn::Value(tn::Dictionary{}));
  EXPECT_EQ(empty["error"], tn::Value("Transmission of environment variables requires the "
                                      "com.ostrel.developer.tenon.provide-environment host entitlement"));
  EXPECT_EQ(registrations(), tn::Value(tn::Array{}));

  // A data plug-in is skipped; the same plug-in twice is enabled once.
  const tn::Value readied = ready({tn::Value(words), tn::Value(upcase), tn::Value(upcase)}, tn::Value(5));
  EXPECT_TRUE(readied["errorcode"].isNull()) << readied << daemon_.log();
  const tn::Value listed = registrations();
  ASSERT_TRUE(listed.array() && listed.array()->size() == 1) << listed;
  EXPECT_EQ((*listed.array())[0]["BNBundleIdentifier"], tn::Value(kPlugIn)) << listed;

  EXPECT_TRUE(ready({})["errorcode"].isNull()) << "nothing named, nothing to do";
}

TEST_F(Readiness, TnctlStartRunsAPlugInForItselfAndRelaysItsStandardStreams) {
  ASSERT_TRUE(daemon_.accepting()) << daemon_.log();
  ASSERT_FALSE(uuidOf("Upcase.tnx").isNil()) << daemon_.log();
  const std::string tnctl =
      tn::test::installFile(TENON_BINARY_DIR "/tools/tnctl/tnctl", daemon_.root(), "usr/bin/tnctl", 0755);
  const std::string input = daemon_.root() + "/input.txt";
  std::ofstream(input) << "quiet words\nand more\n";
  fs::permissions(input, fs::perms(0644));
  const std::string upcase = daemon_.root() + "/" + kApplication + "/Support/PlugIns/Upcase.tnx";
  const bool drop = ::geteuid() == 0;
  const uid_t uid = hostUid_;
  const char* inputPath = input.c_str();
  ChildProcess started({tnctl, "start", upcase, "--service", daemon_.service()},
                       tn::test::environmentWith(daemon_.environment()), [=] {
                         const int fd = ::open(inputPath, O_RDONLY);
                         if (fd < 0 || ::dup2(fd, STDIN_FILENO) < 0) return false;
                         if (!drop) return true;
                         return ::syscall(SYS_setgroups, 0, nullptr) == 0 &&
                                ::syscall(SYS_setresgid, uid, uid, uid) == 0 &&
                                ::syscall(SYS_setresuid, uid, uid, uid) == 0;
                       });
  const tn::test::ProcessResult result = started.finish();
  EXPECT_EQ(result.exitStatus, 0) << result.err << daemon_.log();
  EXPECT_EQ(result.out, "QUIET WORDS\nAND MORE\n");
  EXPECT_EQ(result.err.rfind("tnctl: started com.example.upcase (pid ", 0), 0u) << result.err;
}

}  // namespace
