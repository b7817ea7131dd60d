// Where a system instance and a per-user instance keep their files.

#include <gtest/gtest.h>

#include "platform/paths/InstancePaths.h"

namespace paths {
namespace {

Environment userEnvironment() {
  Environment environment;
  environment.root = "/srv/root";
  environment.instance = "user";
  environment.runtimeDirectory = "/run/user/1000";
  environment.home = "/home/ada";
  return environment;
}

TEST(InstancePaths, TheSystemInstanceKeepsEveryFileUnderThePlatformRoot) {
  Environment environment;
  environment.root = "/srv/root";
  environment.runtimeDirectory = "/run/user/1000";  // ignored by the system instance
  const LayoutResult result = layoutFor(environment);
  ASSERT_TRUE(result.layout) << result.error;
  const Layout& layout = *result.layout;
  EXPECT_EQ(layout.instance, Instance::System);
  EXPECT_EQ(layout.relayDirectory, "/srv/root/run/tenon/relay");
  EXPECT_EQ(layout.notificationDirectory, "/srv/root/run/tenon/notify");
  EXPECT_EQ(layout.annotationFile, "/srv/root/var/db/Tenon-Annotations");
  EXPECT_EQ(layout.preferencesDirectory, "/srv/root/var/lib/tenon/prefs");
  EXPECT_EQ(layout.registrarStore, "/srv/root/var/lib/tenon/registrar.sqlite3");
  EXPECT_EQ(layout.configurationFile, "/srv/root/etc/tenon/tenond.manifest");

  environment.root.clear();
  environment.instance = "system";
  EXPECT_EQ(layoutFor(environment).layout->annotationFile, "/var/db/Tenon-Annotations");
}

TEST(InstancePaths, APerUserInstanceKeepsItsFilesInTheUsersXdgDirectories) {
  Environment environment = userEnvironment();
  environment.stateHome = "/state";
  environment.cacheHome = "/cache";
  environment.configHome = "/config";
  const LayoutResult result = layoutFor(environment);
  ASSERT_TRUE(result.layout) << result.error;
  const Layout& layout = *result.layout;
  EXPECT_EQ(layout.instance, Instance::User);
  EXPECT_EQ(layout.root, "/srv/root") << "what is installed stays the system's";
  EXPECT_EQ(layout.relayDirectory, "/run/user/1000/tenon/relay");
  EXPECT_EQ(layout.notificationDirectory, "/run/user/1000/tenon/notify");
  EXPECT_EQ(layout.annotationFile, "/state/tenon/Tenon-Annotations");
  EXPECT_EQ(layout.preferencesDirectory, "/state/tenon/prefs");
  EXPECT_EQ(layout.sandboxKeyFile, "/state/tenon/sandbox.key");
  EXPECT_EQ(layout.registrarStore, "/cache/tenon/registrar.sqlite3");
  EXPECT_EQ(layout.configurationFile, "/config/tenon/tenond.manifest");
}

TEST(InstancePaths, UnsetOrRelativeXdgDirectoriesFallBackUnderHome) {
  Environment environment = userEnvironment();
  environment.cacheHome = "relative/cache";  // ignored, as the XDG rules say
  const Layout layout = *layoutFor(environment).layout;
  EXPECT_EQ(layout.annotationFile, "/home/ada/.local/state/tenon/Tenon-Annotations");
  EXPECT_EQ(layout.registrarStore, "/home/ada/.cache/tenon/registrar.sqlite3");
  EXPECT_EQ(layout.configurationFile, "/home/ada/.config/tenon/tenond.manifest");
}

TEST(InstancePaths, AnEnvironmentThatCannotPlaceAnInstanceIsNamedAsTheFault) {
  Environment environment = userEnvironment();
  environment.runtimeDirectory.clear();
  LayoutResult result = layoutFor(environment);
  EXPECT_FALSE(result.layout);
  EXPECT_NE(result.error.find("XDG_RUNTIME_DIR"), std::string::npos) << result.error;

  environment = userEnvironment();
  environment.home.clear();
  result = layoutFor(environment);
  EXPECT_FALSE(result.layout);
  EXPECT_NE(result.error.find("HOME"), std::string::npos) << result.error;

  environment = userEnvironment();
  environment.instance = "users";
  result = layoutFor(environment);
  EXPECT_FALSE(result.layout);
  EXPECT_NE(result.error.find("TENON_INSTANCE is \"users\""), std::string::npos) << result.error;
}

}  // namespace
}  // namespace paths
