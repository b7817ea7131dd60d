// Preference domains: values written by one party are read by another at
// once; damaged files are errors that name the file; writers do not lose
// each other's keys.

#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>

#include "platform/prefs/PreferenceDomain.h"
#include "tests/support/TempDirectory.h"

namespace prefs {
namespace {

using tn::Value;

class Preferences : public ::testing::Test {
 protected:
  tn::test::TempRoot temp_;
  const std::string& root_ = temp_.path();
};

TEST_F(Preferences, AMissingDomainIsEmptyAndWritesAreSeenByTheNextRead) {
  const PreferenceDomain reader("com.ostrel.tenon.userprefs", 501);
  EXPECT_FALSE(*reader.value("exclusions"));

  const PreferenceDomain writer("com.ostrel.tenon.userprefs", 501);
  const Value rules(tn::Array{Value(tn::Dictionary{{"XTExtensionPointName", Value("com.example.share")}})});
  ASSERT_TRUE(writer.setValue("exclusions", rules).ok());
  EXPECT_EQ(**reader.value("exclusions"), rules);
  EXPECT_EQ(reader.path(), root_ + "/var/lib/tenon/prefs/501/com.ostrel.tenon.userprefs.manifest");

  struct stat status {};
  ASSERT_EQ(::stat(reader.path().c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 0777, 0600u);
  // Another user's domain of the same name is separate.
  EXPECT_FALSE(*PreferenceDomain("com.ostrel.tenon.userprefs", 502).value("exclusions"));

  ASSERT_TRUE(writer.setValue("exclusions", std::nullopt).ok());
  EXPECT_FALSE(*reader.value("exclusions"));
}

TEST_F(Preferences, TemporariesOfKilledWritersAreRemovedAndLiveOnesKept) {
  const PreferenceDomain domain("com.ostrel.tenon.userprefs", 503);
  ASSERT_TRUE(domain.setValue("a", Value(1)).ok());
  const std::filesystem::path directory = std::filesystem::path(domain.path()).parent_path();
  const auto temporary = [&](const std::string& random) {
    const std::filesystem::path path = directory / (".com.ostrel.tenon.userprefs.manifest.tenon-tmp." + random);
    std::ofstream(path) << "<half";
    return path;
  };
  const std::filesystem::path dead = temporary("DEAD01");
  const std::filesystem::path live = temporary("LIVE01");
  const int liveFd = ::open(live.c_str(), O_RDONLY | O_CLOEXEC);
  ASSERT_GE(liveFd, 0);
  ASSERT_EQ(::flock(liveFd, LOCK_EX), 0);

  ASSERT_TRUE(domain.setValue("b", Value(2)).ok());
  EXPECT_FALSE(std::filesystem::exists(dead)) << "a writer cleans its directory";
  EXPECT_TRUE(std::filesystem::exists(live)) << "a live writer's file stays";
  ::close(liveFd);
  EXPECT_EQ(**domain.value("a"), Value(1));

  // A reader cleans a directory the first time this process reads there.
  const PreferenceDomain unread("com.ostrel.tenon.userprefs", 504);
  const std::filesystem::path other = std::filesystem::path(unread.path()).parent_path();
  std::filesystem::create_directories(other);
  const std::filesystem::path deadThere = other / ".x.manifest.tenon-tmp.DEAD02";
  std::ofstream(deadThere) << "<half";
  EXPECT_FALSE(*unread.value("b"));
  EXPECT_FALSE(std::filesystem::exists(deadThere));
}

TEST_F(Preferences, WritersInOtherProcessesKeepEachOthersKeys) {
  constexpr int kWriters = 8;
  std::vector<pid_t> children;
  for (int i = 0; i < kWriters; ++i) {
    const pid_t pid = ::fork();
    if (pid == 0) {
      const PreferenceDomain domain("com.example.shared", 501);
      _exit(domain.setValue("key" + std::to_string(i), Value(i)).ok() ? 0 : 1);
    }
    children.push_back(pid);
  }
  for (pid_t pid : children) {
    int status = 0;
    ::waitpid(pid, &status, 0);
    EXPECT_EQ(WEXITSTATUS(status), 0);
  }
  const auto all = PreferenceDomain("com.example.shared", 501).values();
  ASSERT_TRUE(all.ok());
  EXPECT_EQ(all->size(), static_cast<size_t>(kWriters));
}

TEST_F(Preferences, DamagedFilesAndBadNamesAreErrorsThatNameTheCulprit) {
  const PreferenceDomain domain("com.example.damaged", 501);
  std::filesystem::create_directories(std::filesystem::path(domain.path()).parent_path());
  std::ofstream(domain.path(), std::ofstream::binary) << "[1, 2";
  auto broken = domain.value("k");
  ASSERT_FALSE(broken.ok());
  EXPECT_EQ(broken.error().code(), static_cast<int64_t>(PreferencesErrorCode::Unreadable));
  EXPECT_NE(broken.error().message()->find(domain.path()), std::string::npos) << broken.error().description();

  std::ofstream(domain.path(), std::ofstream::binary | std::ofstream::trunc) << "[1, 2]";
  EXPECT_EQ(domain.value("k").error().code(), static_cast<int64_t>(PreferencesErrorCode::NotADictionary));

  // Writing replaces the damaged file.
  ASSERT_TRUE(domain.setValue("k", Value(true)).ok());
  EXPECT_EQ(**domain.value("k"), Value(true));

  for (const char* bad : {"", "../escape", ".hidden", "a/b"}) {
    const PreferenceDomain invalid(bad, 501);
    EXPECT_EQ(invalid.value("k").error().code(), static_cast<int64_t>(PreferencesErrorCode::InvalidDomain)) << bad;
    EXPECT_FALSE(invalid.setValue("k", Value(1)).ok()) << bad;
  }
}

}  // namespace
}  // namespace prefs
