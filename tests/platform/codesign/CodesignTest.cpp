// Entitlements and the trust rule. The rule is about file owners, so most
// tests need root (they chown files to another user); they are skipped
// otherwise. Temporary trees live under /tmp, which is sticky and so may
// hold trusted files.

#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include "platform/codesign/Codesign.h"
#include "platform/log/Log.h"
#include "tests/platform/bundle/BundleTestSupport.h"

namespace codesign {
namespace {

using tn::test::makeBundle;
using tn::test::makeDirectory;
using tn::test::TempDirectory;
using tn::test::writeFile;

constexpr uid_t kNobody = 65534;

class Entitlements : public ::testing::Test {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "the trust rule tests change file owners and need root";
    settings_.entitlementsDirectory = root_ / "etc/tenon/entitlements.d";
    settings_.daemonUser = ::geteuid();
    makeDirectory(settings_.entitlementsDirectory);
    app_ = root_ / "App";
    makeBundle(app_, R"({"BNBundleExecutable": "app"})", "app");
    tool_ = root_ / "bin/tool";
    writeFile(tool_, "", 0755);
  }

  static ProcessIdentity process(const std::string& executable) {
    return ProcessIdentity{.pid = 42, .uid = 501, .gid = 20, .startTime = 7, .executablePath = executable,
                           .executableFile = {}};
  }

  // The handle of a process that runs the file at `running` (opened as the
  // daemon opens /proc/<pid>/exe) and whose path reads `executable`.
  TaskHandle handleFor(const std::string& executable, const std::string& running = "") const {
    const int fd = ::open((running.empty() ? executable : running).c_str(), O_PATH | O_CLOEXEC);
    TaskHandle task(process(executable), fd, settings_);
    if (fd >= 0) ::close(fd);
    return task;
  }

  bool anyLineMentions(const std::string& text) const {
    for (const std::string& line : capture_->lines())
      if (line.find(text) != std::string::npos) return true;
    return false;
  }

  // The entitlements document of the tool, written to entitlements.d/<name>.
  std::string writeToolDocument(std::string_view name, std::string_view entitlements, mode_t mode = 0644) {
    const std::string path = settings_.entitlementsDirectory + "/" + std::string(name);
    writeFile(path, R"({"executable": ")" + tool_ + R"(", "entitlements": )" + std::string(entitlements) + "}",
              mode);
    return path;
  }

  bool ignoredWithReason(const std::string& file, std::string_view reason) const {
    for (const std::string& line : capture_->lines()) {
      if (line.find(file) != std::string::npos && line.find(reason) != std::string::npos &&
          line.starts_with("ops error ignoring entitlements")) {
        return true;
      }
    }
    return false;
  }

  TempDirectory root_;
  TrustSettings settings_;
  std::string app_;
  std::string tool_;
  tn::log::ScopedCaptureSink capture_;
};

TEST_F(Entitlements, BundleDocumentIsHonoured) {
  writeFile(app_ + "/Entitlements.manifest", R"({"com.ostrel.tenon.host": true, "groups": ["a"]})");
  const TaskHandle task = handleFor(app_ + "/bin/app");
  EXPECT_EQ(*entitlementValue(task, "com.ostrel.tenon.host"), tn::Value(true));
  EXPECT_EQ(*entitlementValue(task, "groups"), tn::Value(tn::Array{"a"}));
  EXPECT_TRUE(entitlementValue(task, "absent")->isNull());
  EXPECT_TRUE(capture_->lines().empty());
}

TEST_F(Entitlements, DirectoryDocumentNamingTheExecutableIsHonoured) {
  writeToolDocument("tool.manifest", R"({"com.ostrel.tenon.admin": true})");
  // One for another executable, which must be skipped quietly.
  writeFile(settings_.entitlementsDirectory + "/other.manifest",
            R"({"executable": "/usr/bin/other", "entitlements": {"com.ostrel.tenon.root": true}})");
  const TaskHandle task = handleFor(tool_);
  EXPECT_EQ(*entitlementValue(task, "com.ostrel.tenon.admin"), tn::Value(true));
  EXPECT_TRUE(entitlementValue(task, "com.ostrel.tenon.root")->isNull());
  EXPECT_TRUE(capture_->lines().empty());
}

TEST_F(Entitlements, ExecutablePathsAreComparedWithLinksResolved) {
  const std::string linkedBin = root_ / "linked-bin";
  ASSERT_EQ(::symlink((root_ / "bin").c_str(), linkedBin.c_str()), 0);
  writeFile(settings_.entitlementsDirectory + "/tool.manifest",
            R"({"executable": ")" + linkedBin + R"(/tool", "entitlements": {"k": 1}})");
  EXPECT_EQ(*entitlementValue(handleFor(tool_), "k"), tn::Value(1));
}

TEST_F(Entitlements, LaterDocumentsOverrideEarlierOnes) {
  writeFile(root_ / "Tools/Info.manifest", "{}");
  const std::string bundled = root_ / "Tools/bin/tool";
  writeFile(bundled, "", 0755);
  tool_ = bundled;
  writeFile(root_ / "Tools/Entitlements.manifest", R"({"a": "bundle", "b": "bundle"})");
  writeToolDocument("20-local.manifest", R"({"b": "local", "c": "local"})");
  writeToolDocument("10-vendor.manifest", R"({"b": "vendor", "c": "vendor"})");
  const TaskHandle task = handleFor(bundled);
  EXPECT_EQ(*entitlementValue(task, "a"), tn::Value("bundle"));
  EXPECT_EQ(*entitlementValue(task, "b"), tn::Value("local"));
  EXPECT_EQ(*entitlementValue(task, "c"), tn::Value("local"));
}

TEST_F(Entitlements, WritableByGroupIsIgnored) {
  const std::string path = writeToolDocument("tool.manifest", R"({"k": true})", 0664);
  EXPECT_TRUE(entitlementValue(handleFor(tool_), "k")->isNull());
  EXPECT_TRUE(ignoredWithReason(path, "writable by group or others (mode 0664)"));
}

TEST_F(Entitlements, OwnedByAnotherUserIsIgnored) {
  writeFile(app_ + "/Entitlements.manifest", R"({"k": true})");
  ASSERT_EQ(::chown((app_ + "/Entitlements.manifest").c_str(), kNobody, kNobody), 0);
  EXPECT_TRUE(entitlementValue(handleFor(app_ + "/bin/app"), "k")->isNull());
  EXPECT_TRUE(ignoredWithReason(app_ + "/Entitlements.manifest", "owned by uid 65534"));
}

TEST_F(Entitlements, OwnedByTheDaemonsUserIsHonoured) {
  const std::string path = writeToolDocument("tool.manifest", R"({"k": true})");
  ASSERT_EQ(::chown(path.c_str(), kNobody, kNobody), 0);
  ASSERT_EQ(::chown(tool_.c_str(), kNobody, kNobody), 0);
  settings_.daemonUser = kNobody;
  EXPECT_EQ(*entitlementValue(handleFor(tool_), "k"), tn::Value(true));
}

TEST_F(Entitlements, DirectoryWritableByOthersIsIgnoredUnlessSticky) {
  makeDirectory(root_ / "open", 0777);
  settings_.entitlementsDirectory = root_ / "open/entitlements.d";
  makeDirectory(settings_.entitlementsDirectory);
  const std::string path = writeToolDocument("tool.manifest", R"({"k": true})");
  EXPECT_TRUE(entitlementValue(handleFor(tool_), "k")->isNull());
  EXPECT_TRUE(ignoredWithReason(path, "directory " + root_ / "open" +
                                          " is writable by group or others and not sticky (mode 0777)"));

  ASSERT_EQ(::chmod((root_ / "open").c_str(), 01777), 0);
  capture_->clear();
  EXPECT_EQ(*entitlementValue(handleFor(tool_), "k"), tn::Value(true));
  EXPECT_TRUE(capture_->lines().empty());
}

TEST_F(Entitlements, DirectoryOwnedByAnotherUserIsIgnored) {
  makeDirectory(root_ / "theirs", 0755);
  ASSERT_EQ(::chown((root_ / "theirs").c_str(), kNobody, kNobody), 0);
  settings_.entitlementsDirectory = root_ / "theirs/entitlements.d";
  makeDirectory(settings_.entitlementsDirectory);
  const std::string path = writeToolDocument("tool.manifest", R"({"k": true})");
  EXPECT_TRUE(entitlementValue(handleFor(tool_), "k")->isNull());
  EXPECT_TRUE(ignoredWithReason(path, "directory " + root_ / "theirs" + " is owned by uid 65534"));
}

TEST_F(Entitlements, LinkToAnUntrustedFileIsJudgedWhereItLeads) {
  makeDirectory(root_ / "open", 0777);
  writeFile(root_ / "open/tool.manifest",
            R"({"executable": ")" + tool_ + R"(", "entitlements": {"k": true}})");
  const std::string link = settings_.entitlementsDirectory + "/tool.manifest";
  ASSERT_EQ(::symlink((root_ / "open/tool.manifest").c_str(), link.c_str()), 0);
  EXPECT_TRUE(entitlementValue(handleFor(tool_), "k")->isNull());
  EXPECT_TRUE(ignoredWithReason(link, "not sticky"));
}

TEST_F(Entitlements, UntrustedExecutableGetsNothing) {
  writeToolDocument("tool.manifest", R"({"k": true})");
  ASSERT_EQ(::chmod(tool_.c_str(), 0775), 0);
  EXPECT_TRUE(entitlementValue(handleFor(tool_), "k")->isNull());
  EXPECT_TRUE(capture_->contains("ops", tn::log::Level::Error, "ignoring entitlements of executable " + tool_));

  ASSERT_EQ(::chmod(tool_.c_str(), 0755), 0);
  ASSERT_EQ(::chown(tool_.c_str(), kNobody, kNobody), 0);
  EXPECT_TRUE(entitlementValue(handleFor(tool_), "k")->isNull());
  EXPECT_TRUE(capture_->contains("ops", tn::log::Level::Error, "owned by uid 65534"));
}

// The executable is judged before anything its bundle holds is opened: an
// untrusted program's bundle document (here a FIFO, which would be named
// as "not a regular file" if it were looked at) is never touched, and
// without a document of entitlements.d naming the program nothing is logged.
TEST_F(Entitlements, AnUntrustedExecutablesBundleIsNeverRead) {
  makeDirectory(root_ / "open", 0777);
  makeBundle(root_ / "open/App", R"({"BNBundleExecutable": "app"})", "app");
  const std::string document = root_ / "open/App/Entitlements.manifest";
  ASSERT_EQ(::mkfifo(document.c_str(), 0644), 0);
  const std::size_t parses = DocumentCache::shared().parseCount();
  EXPECT_TRUE(handleFor(root_ / "open/App/bin/app").entitlements().dictionary()->empty());
  EXPECT_FALSE(anyLineMentions(document));
  EXPECT_TRUE(capture_->lines().empty());
  EXPECT_EQ(DocumentCache::shared().parseCount(), parses);

  // The same FIFO beside a trusted executable is looked at, and refused.
  makeBundle(root_ / "Safe", R"({"BNBundleExecutable": "app"})", "app");
  ASSERT_EQ(::mkfifo((root_ / "Safe/Entitlements.manifest").c_str(), 0644), 0);
  EXPECT_TRUE(handleFor(root_ / "Safe/bin/app").entitlements().dictionary()->empty());
  EXPECT_TRUE(ignoredWithReason(root_ / "Safe/Entitlements.manifest", "not a regular file"));
}

// Documents grant the file, not the name: a process running another file
// whose path reads the same (a copy mounted over the path in its own mount
// namespace) gets nothing, even when that file would pass the trust rule.
TEST_F(Entitlements, EntitlementsBelongToTheFileNotToItsPath) {
  writeToolDocument("tool.manifest", R"({"k": true})");
  const std::string copy = root_ / "bin/copy";
  writeFile(copy, "", 0755);
  EXPECT_TRUE(handleFor(tool_, copy).entitlements().dictionary()->empty());
  EXPECT_EQ(*entitlementValue(handleFor(tool_), "k"), tn::Value(true));

  writeFile(app_ + "/Entitlements.manifest", R"({"b": true})");
  const std::string otherApp = root_ / "bin/other-app";
  writeFile(otherApp, "", 0755);
  EXPECT_TRUE(handleFor(app_ + "/bin/app", otherApp).entitlements().dictionary()->empty());
  EXPECT_TRUE(ignoredWithReason(app_ + "/Entitlements.manifest", "is not the file the process runs"));
  EXPECT_EQ(*entitlementValue(handleFor(app_ + "/bin/app"), "b"), tn::Value(true));
}

TEST_F(Entitlements, AFinalLinkInTheNamedExecutableIsFollowed) {
  const std::string link = root_ / "bin/tool-link";
  ASSERT_EQ(::symlink(tool_.c_str(), link.c_str()), 0);
  writeFile(settings_.entitlementsDirectory + "/tool.manifest",
            R"({"executable": ")" + link + R"(", "entitlements": {"k": 1}})");
  EXPECT_EQ(*entitlementValue(handleFor(tool_), "k"), tn::Value(1));
}

TEST_F(Entitlements, AProcessWhoseExecutableCannotBeOpenedHasNoEntitlements) {
  writeToolDocument("tool.manifest", R"({"k": true})");
  const TaskHandle task(process(tool_), -1, settings_);
  EXPECT_TRUE(task.entitlements().dictionary()->empty());
  EXPECT_FALSE(task.identity().executableFile.has_value());
  const tn::Result<tn::Value> value = entitlementValue(task, "k");
  ASSERT_FALSE(value);
  EXPECT_EQ(value.error().code(), static_cast<int64_t>(CodesignErrorCode::NoExecutable));
}

// An untrusted document is not parsed, and is named whatever it names.
TEST_F(Entitlements, AnUntrustedDocumentIsNeverParsed) {
  const std::string path = settings_.entitlementsDirectory + "/other.manifest";
  writeFile(path, R"({"executable": "/usr/bin/other", "entitlements": {"k": true}})", 0666);
  const std::size_t parses = DocumentCache::shared().parseCount();
  EXPECT_TRUE(handleFor(tool_).entitlements().dictionary()->empty());
  EXPECT_EQ(DocumentCache::shared().parseCount(), parses);
  EXPECT_TRUE(ignoredWithReason(path, "writable by group or others (mode 0666)"));
}

TEST_F(Entitlements, MalformedDocumentsAreIgnoredAndNamed) {
  const std::string directory = settings_.entitlementsDirectory;
  writeFile(directory + "/list.manifest", R"(["executable"])");
  writeFile(directory + "/relative.manifest", R"({"executable": "bin/tool", "entitlements": {"k": 1}})");
  writeFile(directory + "/flat.manifest", R"({"executable": "/x", "entitlements": true})");
  writeFile(directory + "/broken.manifest", R"({"executable": )");
  ASSERT_EQ(::mkfifo((directory + "/fifo.manifest").c_str(), 0644), 0);
  writeFile(directory + "/.hidden.manifest", R"(["never read"])");
  writeFile(directory + "/notes.txt", R"(["never read"])");
  writeFile(app_ + "/Entitlements.manifest", R"(["k"])");

  EXPECT_TRUE(handleFor(app_ + "/bin/app").entitlements().dictionary()->empty());
  for (const char* name : {"list", "relative", "flat", "broken", "fifo"}) {
    EXPECT_TRUE(ignoredWithReason(directory + "/" + name + ".manifest", "")) << name;
  }
  EXPECT_TRUE(ignoredWithReason(app_ + "/Entitlements.manifest", "not a dictionary"));
  EXPECT_EQ(capture_->lines().size(), 6U);
}

TEST_F(Entitlements, UnknownExecutableIsAnError) {
  const TaskHandle task(process(""), -1, settings_);
  const tn::Result<tn::Value> value = entitlementValue(task, "k");
  ASSERT_FALSE(value);
  EXPECT_EQ(value.error().domain(), kCodesignErrorDomain);
  EXPECT_EQ(value.error().code(), static_cast<int64_t>(CodesignErrorCode::NoExecutable));
}

TEST(EntitlementIsGranted, FalseAndZeroDenyEverythingElsePresentGrants) {
  EXPECT_FALSE(entitlementIsGranted(tn::Value()));
  EXPECT_FALSE(entitlementIsGranted(tn::Value(false)));
  EXPECT_FALSE(entitlementIsGranted(tn::Value(0)));
  EXPECT_FALSE(entitlementIsGranted(tn::Value(0U)));
  EXPECT_FALSE(entitlementIsGranted(tn::Value(0.0)));
  EXPECT_TRUE(entitlementIsGranted(tn::Value(true)));
  EXPECT_TRUE(entitlementIsGranted(tn::Value(1)));
  EXPECT_TRUE(entitlementIsGranted(tn::Value(2)));
  EXPECT_TRUE(entitlementIsGranted(tn::Value("")));
  EXPECT_TRUE(entitlementIsGranted(tn::Value("false")));
  EXPECT_TRUE(entitlementIsGranted(tn::Value(tn::Array{})));
  EXPECT_TRUE(entitlementIsGranted(tn::Value(tn::Array{"group.a"})));
  EXPECT_TRUE(entitlementIsGranted(tn::Value(tn::Dictionary{})));
}

}  // namespace
}  // namespace codesign
