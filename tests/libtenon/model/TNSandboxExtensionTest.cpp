// Sandbox extensions in the model: issuing for URLs and service names with
// their log lines, and TNSandboxExtension's idempotent consume and expel,
// release on destruction and equality by token.

#include "libtenon/model/TNSandboxExtension.h"

#include <gtest/gtest.h>

#include <unistd.h>

#include <cerrno>
#include <cstdlib>

#include "platform/sandbox/Extensions.h"
#include "tests/libtenon/model/PlugInTestSupport.h"
#include "tests/platform/bundle/BundleTestSupport.h"

namespace tn {
namespace {

using log::Level;

class SandboxExtensionTest : public test::ModelTest {
 protected:
  void SetUp() override {
    test::ModelTest::SetUp();
    ::setenv("TENON_ROOT", root_.path().c_str(), 1);
    test::makeDirectory(root_ / "Plug.tnx/Shared");
  }
  void TearDown() override {
    ::unsetenv("TENON_ROOT");
    test::ModelTest::TearDown();
  }

  test::TempDirectory root_;
};

// A manifest names resources relative to its bundle; nothing it names may
// reach outside the bundle, lexically or through links.
TEST_F(SandboxExtensionTest, BundleResourcesStayInsideTheBundle) {
  const std::string bundle = root_ / "Plug.tnx";
  test::makeDirectory(root_ / "Outside");
  ASSERT_EQ(::symlink("/", (bundle + "/Root").c_str()), 0);
  ASSERT_EQ(::symlink("../Outside", (bundle + "/Escape").c_str()), 0);
  ASSERT_EQ(::symlink("Shared", (bundle + "/Alias").c_str()), 0);
  ASSERT_EQ(::symlink(bundle.c_str(), (bundle + "/Self").c_str()), 0);
  ASSERT_EQ(::symlink("Shared/../../Plug.tnx/Shared", (bundle + "/Roundabout").c_str()), 0);

  // Inside: the bundle itself, plain names, links that stay in.
  EXPECT_EQ(*bundleResourcePath(bundle, "."), bundle);
  EXPECT_EQ(*bundleResourcePath(bundle + "/", "Shared"), bundle + "/Shared");
  EXPECT_EQ(*bundleResourcePath(bundle, "./Shared/."), bundle + "/Shared");
  EXPECT_EQ(*bundleResourcePath(bundle, "Alias"), bundle + "/Shared");
  EXPECT_EQ(*bundleResourcePath(bundle, "Self"), bundle);
  EXPECT_EQ(*bundleResourcePath(bundle, "Roundabout"), bundle + "/Shared");

  // Refused (EPERM): by name alone, or by where links lead.
  for (const std::string_view name :
       {std::string_view("/etc/passwd"), std::string_view("../"), std::string_view(".."),
        std::string_view("Shared/../../Outside"), std::string_view("Shared/.."), std::string_view(""),
        std::string_view("Shared\0x", 8), std::string_view("Root"), std::string_view("Root/etc/passwd"),
        std::string_view("Escape")}) {
    const Result<std::string> path = bundleResourcePath(bundle, name);
    ASSERT_FALSE(path) << name << " -> " << *path;
    EXPECT_EQ(path.error().code(), EPERM) << name;
  }
  // Missing: not a refusal, just nothing there.
  EXPECT_EQ(bundleResourcePath(bundle, "Absent").error().code(), ENOENT);

  // The token names the checked canonical path.
  const Result<std::string> token = issueBundleResourceExtension(URL::fileURLWithPath(bundle), "Alias");
  ASSERT_TRUE(token) << token.error().description();
  TNSandboxExtension holder(*token);
  holder.consume();
  ASSERT_TRUE(holder.isConsumed());
  EXPECT_EQ(sandbox::heldExtension(holder.handle())->subject, bundle + "/Shared");
  EXPECT_EQ(issueBundleResourceExtension(URL::fileURLWithPath(bundle), "Root").error().code(), EPERM);
}

TEST_F(SandboxExtensionTest, IssuesForCanonicalPathsAndServiceNames) {
  const URL indirect = URL::fileURLWithPath(root_ / "Plug.tnx/Shared/../Shared");
  const Result<std::string> file = issueFileExtension(indirect);
  ASSERT_TRUE(file) << file.error().description();
  EXPECT_TRUE(logged("sandbox", Level::Debug, "issued file extension for " + indirect.path() + " -> " + *file));

  TNSandboxExtension holder(*file);
  holder.consume();
  ASSERT_TRUE(holder.isConsumed());
  const std::optional<sandbox::ExtensionGrant> grant = sandbox::heldExtension(holder.handle());
  ASSERT_TRUE(grant);
  EXPECT_EQ(grant->subject, root_ / "Plug.tnx/Shared");
  EXPECT_EQ(grant->extensionClass, sandbox::kReadOnlyFileExtensionClass);

  const Result<std::string> service = issueServiceExtension("com.example.plugin");
  ASSERT_TRUE(service);
  EXPECT_TRUE(logged("sandbox", Level::Debug, "issued mach extension for com.example.plugin -> " + *service));
  TNSandboxExtension serviceHolder(*service);
  serviceHolder.consume();
  EXPECT_EQ(sandbox::heldExtension(serviceHolder.handle())->extensionClass, "com.ostrel.tenon.plugin-service");

  const Result<std::string> missing = issueFileExtension(URL::fileURLWithPath(root_ / "absent"));
  ASSERT_FALSE(missing);
  EXPECT_EQ(missing.error().code(), ENOENT);
  EXPECT_FALSE(issueServiceExtension(""));
}

TEST_F(SandboxExtensionTest, ConsumeAndExpelAreIdempotent) {
  const Result<std::string> token = issueFileExtension(URL::fileURLWithPath(root_ / "Plug.tnx"));
  ASSERT_TRUE(token);
  TNSandboxExtension holder(*token);
  EXPECT_EQ(holder.handle(), -1);
  holder.consume();
  const int64_t handle = holder.handle();
  ASSERT_NE(handle, -1);
  holder.consume();
  EXPECT_EQ(holder.handle(), handle);
  EXPECT_EQ(capture_->count("sandbox", Level::Debug, "consuming extension"), 1u);
  EXPECT_TRUE(logged("sandbox", Level::Debug, fmt::format("consuming extension {} -> {}", *token, handle)));

  holder.expel();
  EXPECT_EQ(holder.handle(), -1);
  EXPECT_FALSE(sandbox::heldExtension(handle));
  holder.expel();
  EXPECT_EQ(capture_->count("sandbox", Level::Debug, "releasing extension"), 1u);
  EXPECT_TRUE(logged("sandbox", Level::Debug, fmt::format("releasing extension {}", handle)));

  // Consumable again after release, with a new handle.
  holder.consume();
  EXPECT_NE(holder.handle(), -1);
  EXPECT_NE(holder.handle(), handle);
}

TEST_F(SandboxExtensionTest, ARefusedTokenStaysUnconsumedAndLogsItsCode) {
  const Result<std::string> token = issueFileExtension(URL::fileURLWithPath(root_ / "Plug.tnx"));
  ASSERT_TRUE(token);
  std::string altered = *token;
  altered[altered.size() / 2] = altered[altered.size() / 2] == 'a' ? 'b' : 'a';
  TNSandboxExtension holder(altered);
  holder.consume();
  EXPECT_EQ(holder.handle(), -1);
  EXPECT_TRUE(logged("sandbox", Level::Default, "failed to consume extension " + altered + " - errno="));

  TNSandboxExtension garbage("garbage");
  garbage.consume();
  EXPECT_TRUE(logged("sandbox", Level::Default, fmt::format("failed to consume extension garbage - errno={}", EINVAL)));
  garbage.expel();  // not consumed: nothing to release, nothing logged
  EXPECT_FALSE(logged("sandbox", Level::Default, "failed to release"));
}

TEST_F(SandboxExtensionTest, DestructionReleasesAndAFailedReleaseStillClearsTheHandle) {
  const Result<std::string> token = issueFileExtension(URL::fileURLWithPath(root_ / "Plug.tnx"));
  ASSERT_TRUE(token);
  int64_t handle = -1;
  {
    TNSandboxExtension holder(*token);
    holder.consume();
    handle = holder.handle();
    ASSERT_TRUE(sandbox::heldExtension(handle));
  }
  EXPECT_FALSE(sandbox::heldExtension(handle));

  TNSandboxExtension holder(*token);
  holder.consume();
  ASSERT_TRUE(sandbox::releaseExtension(holder.handle()));  // released behind the holder's back
  const int64_t stale = holder.handle();
  holder.expel();
  EXPECT_EQ(holder.handle(), -1);
  EXPECT_TRUE(logged("sandbox", Level::Default, fmt::format("failed to release extension {} - errno={}", stale, EBADF)));
}

TEST_F(SandboxExtensionTest, HoldersAreEqualByTokenWhateverTheirHandles) {
  const Result<std::string> token = issueServiceExtension("com.example.plugin");
  ASSERT_TRUE(token);
  TNSandboxExtension consumed(*token);
  consumed.consume();
  TNSandboxExtension idle(*token);
  TNSandboxExtension other(*issueServiceExtension("com.example.other"));
  EXPECT_TRUE(consumed == idle);
  EXPECT_FALSE(consumed == other);
  EXPECT_FALSE(idle.isEqual(nullptr));
}

}  // namespace
}  // namespace tn
