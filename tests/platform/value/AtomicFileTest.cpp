// The atomic file write: contents and mode on success; on every failure the
// old file untouched and no temporary file left behind.

#include <gtest/gtest.h>

#include <fcntl.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <thread>

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


// What a writer killed during a save leaves: its temporary file, unlocked.
fs::path leaveTemporary(const fs::path& dir, const std::string& name, const std::string& random) {
  const fs::path path = dir / ("." + name + std::string(kTemporaryMarker) + random);
  std::ofstream(path) << "half a document";
  return path;
}

TEST_F(AtomicFile, StaleTemporariesAreRemovedAndEverythingElseIsKept) {
  ASSERT_TRUE(writeFileAtomically(target_, "the file"));
  leaveTemporary(dir_, "annotations", "Ab12Zz");
  leaveTemporary(dir_, "other.manifest", "q9W8e7");
  // A live writer: its temporary is locked (by another open file description).
  const fs::path live = leaveTemporary(dir_, "annotations", "LIVE00");
  const int liveFd = ::open(live.c_str(), O_RDONLY | O_CLOEXEC);
  ASSERT_GE(liveFd, 0);
  ASSERT_EQ(::flock(liveFd, LOCK_EX), 0);
  // Not ours: other names, a link named like a temporary, a directory.
  std::ofstream(dir_ / ".annotations.tmp-ABCDEF") << "someone else's";
  std::ofstream(dir_ / ".annotations.tenon-tmp.short") << "not six random characters";
  std::ofstream(dir_ / "elsewhere") << "untouched";
  fs::create_symlink(dir_ / "elsewhere", dir_ / ".link.tenon-tmp.AAAAAA");
  fs::create_directory(dir_ / ".dir.tenon-tmp.BBBBBB");

  const Result<size_t> removed = removeStaleTemporaryFiles(dir_);
  ::close(liveFd);
  ASSERT_TRUE(removed) << removed.error().description();
  EXPECT_EQ(*removed, 2u);
  expectDirectoryHolds({"annotations", ".annotations.tenon-tmp.LIVE00", ".annotations.tmp-ABCDEF",
                        ".annotations.tenon-tmp.short", "elsewhere", ".link.tenon-tmp.AAAAAA",
                        ".dir.tenon-tmp.BBBBBB"});
  EXPECT_EQ(contentsOf(target_), "the file");
  EXPECT_EQ(contentsOf(dir_ / "elsewhere"), "untouched");

  EXPECT_EQ(removeStaleTemporaryFiles(dir_ / "absent").error().code(), ENOENT);
}

// Writers killed at any instant leave temporaries; cleaning removes them
// all, and the file is always one whole version.
TEST_F(AtomicFile, CleaningAfterKilledWritersLeavesNoTemporaryAndAWholeFile) {
  const std::string big(256 * 1024, 'x');
  ASSERT_TRUE(writeFileAtomically(target_, "v0" + big));
  for (int round = 0; round < 20; ++round) {
    const pid_t child = ::fork();
    if (child == 0) {
      for (int i = 0;; ++i) (void)writeFileAtomically(target_, "v" + std::to_string(i) + big);
    }
    // Kill it while it writes: wait until one of its temporaries is there.
    for (int i = 0; i < 100000; ++i) {
      bool seen = false;
      for (const auto& entry : fs::directory_iterator(dir_))
        seen = seen || entry.path().filename().string().find(kTemporaryMarker) != std::string::npos;
      if (seen) break;
    }
    ::kill(child, SIGKILL);
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
  }
  ASSERT_TRUE(removeStaleTemporaryFiles(dir_));
  expectDirectoryHolds({"annotations"});
  const std::string contents = contentsOf(target_);
  ASSERT_EQ(contents.size() - contents.find('x'), big.size());
  EXPECT_EQ(contents.front(), 'v');
}

// A cleaner running while this process writes never removes the writer's
// file from under it: every save succeeds.
TEST_F(AtomicFile, ConcurrentCleaningNeverBreaksASave) {
  std::atomic<bool> stop{false};
  std::thread cleaner([&] {
    while (!stop.load()) (void)removeStaleTemporaryFiles(dir_);
  });
  int failures = 0;
  for (int i = 0; i < 300; ++i) failures += writeFileAtomically(target_, std::to_string(i)).ok() ? 0 : 1;
  stop.store(true);
  cleaner.join();
  EXPECT_EQ(failures, 0);
  EXPECT_EQ(contentsOf(target_), "299");
  expectDirectoryHolds({"annotations"});
}

}  // namespace
}  // namespace tn

namespace tn {
namespace {

TEST_F(AtomicFile, CreatingOnlyCreatesOnceNeverReplacesAndLeavesNoTemporary) {
  ASSERT_TRUE(createFileAtomically(target_.string(), "first", 0600));
  const Result<void> again = createFileAtomically(target_.string(), "second", 0600);
  ASSERT_FALSE(again);
  EXPECT_EQ(again.error().code(), EEXIST);
  EXPECT_EQ(contentsOf(target_), "first");
  EXPECT_EQ(modeOf(target_), 0600u);
  EXPECT_EQ(std::distance(fs::directory_iterator(dir_), fs::directory_iterator()), 1);
}

}  // namespace
}  // namespace tn
