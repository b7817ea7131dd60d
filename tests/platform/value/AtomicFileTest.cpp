// The atomic file write: contents and mode on success; on every failure the
// old file untouched and no temporary file left behind.

#include <gtest/gtest.h>

#include <fcntl.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <sstream>

#include "platform/value/AtomicFile.h"

namespace tn {
namespace {

namespace fs = std::filesystem;

std::string contentsOf(const fs::path& path) {
  std::ifstream in(path, std::ifstream::binary);
  std::stringstream s;
  s << in.rdbuf();
  return s.str();
}

mode_t modeOf(const fs::path& path) {
  struct stat st {};
  EXPECT_EQ(::stat(path.c_str(), &st), 0);
  return st.st_mode & 07777;
}

// Whether this process may create files in dir (a privileged process may,
// whatever the directory's mode).
bool canCreateFileIn(const fs::path& dir) {
  const fs::path probe = dir / "probe";
  const int fd = ::open(probe.c_str(), O_CREAT | O_WRONLY, 0600);
  if (fd < 0) return false;
  ::close(fd);
  ::unlink(probe.c_str());
  return true;
}

class AtomicFile : public ::testing::Test {
 protected:
  void SetUp() override {
    dir_ = fs::temp_directory_path() / ("atomic-file-test-" + std::to_string(::getpid()));
    fs::create_directories(dir_);
    target_ = dir_ / "annotations";
  }
  void TearDown() override {
    fs::permissions(dir_, fs::perms::owner_all);
    fs::remove_all(dir_);
  }

  // The directory holds exactly these names (no temporary left over).
  void expectDirectoryHolds(std::vector<std::string> names) {
    std::vector<std::string> found;
    for (const auto& entry : fs::directory_iterator(dir_)) found.push_back(entry.path().filename().string());
    std::sort(found.begin(), found.end());
    std::sort(names.begin(), names.end());
    EXPECT_EQ(found, names);
  }

  fs::path dir_;
  fs::path target_;
};

TEST_F(AtomicFile, CreatesAndReplacesWithTheExactMode) {
  ASSERT_TRUE(writeFileAtomically(target_, "first", 0600));
  EXPECT_EQ(contentsOf(target_), "first");
  EXPECT_EQ(modeOf(target_), 0600u);

  // The mode is applied as given, not filtered by the umask.
  const mode_t oldMask = ::umask(077);
  const Result<void> replaced = writeFileAtomically(target_, std::string("second\0with nul", 15), 0644);
  ::umask(oldMask);
  ASSERT_TRUE(replaced) << replaced.error().localizedDescription();
  EXPECT_EQ(contentsOf(target_), std::string("second\0with nul", 15));
  EXPECT_EQ(modeOf(target_), 0644u);

  ASSERT_TRUE(writeFileAtomically(target_, ""));
  EXPECT_EQ(contentsOf(target_), "");
  expectDirectoryHolds({"annotations"});
}

TEST_F(AtomicFile, AMissingDirectoryFailsNamingThePath) {
  const std::string path = (dir_ / "absent" / "file").string();
  const Result<void> written = writeFileAtomically(path, "x");
  ASSERT_FALSE(written);
  EXPECT_EQ(written.error().domain(), kFileErrorDomain);
  EXPECT_EQ(written.error().code(), ENOENT);
  EXPECT_EQ(written.error().localizedDescription(), path + ": cannot create a temporary file: No such file or directory");
  expectDirectoryHolds({});
}

TEST_F(AtomicFile, AFailedReplaceLeavesTheOldFileAndNoTemporary) {
  // A directory in the way: everything succeeds up to the rename.
  fs::create_directory(target_);
  std::ofstream(target_ / "inside") << "kept";
  const Result<void> written = writeFileAtomically(target_, "new");
  ASSERT_FALSE(written);
  EXPECT_EQ(written.error().localizedDescription(), target_.string() + ": cannot replace the file: Is a directory");
  EXPECT_EQ(contentsOf(target_ / "inside"), "kept");
  expectDirectoryHolds({"annotations"});
}

TEST_F(AtomicFile, AReadOnlyDirectoryFailsAndLeavesTheOldFile) {
  ASSERT_TRUE(writeFileAtomically(target_, "old"));
  fs::permissions(dir_, fs::perms::owner_read | fs::perms::owner_exec | fs::perms::group_read |
                            fs::perms::group_exec | fs::perms::others_read | fs::perms::others_exec);
  const auto failsWithPermissionDenied = [&] {
    const Result<void> written = writeFileAtomically(target_, "new");
    return !written && written.error().code() == EACCES &&
           written.error().localizedDescription() == target_.string() + ": cannot create a temporary file: Permission denied";
  };
  if (!canCreateFileIn(dir_)) {
    EXPECT_TRUE(failsWithPermissionDenied());
  } else if (::geteuid() == 0) {
    // Root writes anyway; an unprivileged child meets the permission check.
    const pid_t child = ::fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
      if (::setgid(65534) != 0 || ::setuid(65534) != 0) ::_exit(2);
      ::_exit(failsWithPermissionDenied() ? 0 : 1);
    }
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    ASSERT_TRUE(WIFEXITED(status));
    if (WEXITSTATUS(status) == 2) GTEST_SKIP() << "cannot drop privileges to provoke the failure";
    EXPECT_EQ(WEXITSTATUS(status), 0) << "the write did not fail with EACCES";
  } else {
    GTEST_SKIP() << "this user may write into read-only directories";
  }
  EXPECT_EQ(contentsOf(target_), "old");
  expectDirectoryHolds({"annotations"});
}

TEST_F(AtomicFile, AWriteThatFailsHalfwayLeavesTheOldFileAndNoTemporary) {
  ASSERT_TRUE(writeFileAtomically(target_, "old contents"));
  // A file size limit makes the write itself fail after a few bytes, even for
  // root. It is set in a child so that this process keeps its limits.
  const pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    ::signal(SIGXFSZ, SIG_IGN);
    const rlimit limit{4, 4};
    ::setrlimit(RLIMIT_FSIZE, &limit);
    const Result<void> written = writeFileAtomically(target_, std::string(100, 'n'));
    const bool asExpected = !written && written.error().code() == EFBIG &&
                            written.error().localizedDescription() == target_.string() + ": cannot write: File too large";
    ::_exit(asExpected ? 0 : 1);
  }
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0) << "the write did not fail as expected";
  EXPECT_EQ(contentsOf(target_), "old contents");
  expectDirectoryHolds({"annotations"});
}

TEST_F(AtomicFile, ASymbolicLinkIsReplacedNotFollowed) {
  const fs::path elsewhere = dir_ / "elsewhere";
  std::ofstream(elsewhere) << "untouched";
  fs::create_symlink(elsewhere, target_);
  ASSERT_TRUE(writeFileAtomically(target_, "new"));
  EXPECT_FALSE(fs::is_symlink(target_));
  EXPECT_EQ(contentsOf(target_), "new");
  EXPECT_EQ(contentsOf(elsewhere), "untouched");
}

}  // namespace
}  // namespace tn
