// The is-sandboxed test: parsing /proc, and real processes with and without
// a seccomp filter of their own.

#include <gtest/gtest.h>

#include <sys/wait.h>
#include <unistd.h>

#include <cstddef>

#include "platform/sandbox/SandboxCheck.h"
#include "tests/support/SeccompFilter.h"

namespace sandbox {
namespace {

using tn::test::installAllowAllFilter;

// A child process that (optionally) installs a filter, reports that it is
// ready, and lives until the object is destroyed.
class Child {
 public:
  explicit Child(bool sandboxed) {
    int ready[2];
    int release[2];
    EXPECT_EQ(::pipe(ready), 0);
    EXPECT_EQ(::pipe(release), 0);
    pid_ = ::fork();
    if (pid_ == 0) {
      ::close(ready[0]);
      ::close(release[1]);
      const char status = (!sandboxed || installAllowAllFilter()) ? 'y' : 'n';
      if (::write(ready[1], &status, 1) != 1) ::_exit(1);
      char ignored;
      while (::read(release[0], &ignored, 1) > 0) {
      }
      ::_exit(0);
    }
    ::close(ready[1]);
    ::close(release[0]);
    release_ = release[1];
    char status = 0;
    EXPECT_EQ(::read(ready[0], &status, 1), 1);
    EXPECT_EQ(status, 'y') << "the child could not install its filter";
    ::close(ready[0]);
  }
  ~Child() { reap(); }
  Child(const Child&) = delete;
  Child& operator=(const Child&) = delete;

  pid_t pid() const { return pid_; }

  // Lets the child exit and waits for it; afterwards pid() names nothing.
  void reap() {
    if (release_ < 0) return;
    ::close(release_);
    release_ = -1;
    int status = 0;
    ::waitpid(pid_, &status, 0);
  }

 private:
  pid_t pid_ = -1;
  int release_ = -1;
};

TEST(SandboxCheck, ChildWithItsOwnFilterIsSandboxed) {
  Child child(/*sandboxed=*/true);
  EXPECT_TRUE(isProcessSandboxed(child.pid()));
  EXPECT_EQ(*seccompFilterCount(child.pid()), *seccompFilterCount(::getpid()) + 1);

  const std::optional<uint64_t> startTime = processStartTime(child.pid());
  ASSERT_TRUE(startTime);
  EXPECT_TRUE(isProcessSandboxed(child.pid(), *startTime));
  // The same pid with another start time is another process.
  EXPECT_FALSE(isProcessSandboxed(child.pid(), *startTime + 1));
}

TEST(SandboxCheck, ChildWithOnlyInheritedFiltersIsNot) {
  Child child(/*sandboxed=*/false);
  EXPECT_FALSE(isProcessSandboxed(child.pid()));
  EXPECT_FALSE(isProcessSandboxed(child.pid(), *processStartTime(child.pid())));
  EXPECT_FALSE(isProcessSandboxed(::getpid()));
}

TEST(SandboxCheck, VanishedProcessIsNot) {
  Child child(/*sandboxed=*/true);
  const pid_t pid = child.pid();
  child.reap();
  EXPECT_FALSE(isProcessSandboxed(pid));
  EXPECT_EQ(processStartTime(pid), std::nullopt);
  EXPECT_FALSE(isProcessSandboxed(0));
  EXPECT_FALSE(isProcessSandboxed(-1));
}

TEST(SandboxCheckParsing, SeccompFilterCount) {
  EXPECT_EQ(parseSeccompFilterCount("Name:\tx\nSeccomp:\t2\nSeccomp_filters:\t3\nSpeculation:\tx\n"), 3U);
  EXPECT_EQ(parseSeccompFilterCount("Seccomp_filters:\t0"), 0U);
  // Kernels before 5.9 report only the mode.
  EXPECT_EQ(parseSeccompFilterCount("Name:\tx\nSeccomp:\t2\n"), 1U);
  EXPECT_EQ(parseSeccompFilterCount("Seccomp:\t0\n"), 0U);
  EXPECT_EQ(parseSeccompFilterCount("Name:\tSeccomp_filters: 9\n"), std::nullopt);
  EXPECT_EQ(parseSeccompFilterCount("Seccomp_filters:\tmany\n"), std::nullopt);
  EXPECT_EQ(parseSeccompFilterCount(""), std::nullopt);
}

TEST(SandboxCheckParsing, StartTimeSurvivesHostileCommandNames) {
  // Fields 3 to 21, then the start time (22), then more.
  const std::string tail = " S 1 2 3 4 5 6 7 8 9 10 11 12 13 14 15 16 17 18 123456789 19 20\n";
  EXPECT_EQ(parseStartTime("17 (sh)" + tail), 123456789U);
  EXPECT_EQ(parseStartTime("17 (a) 1 2 3 (b) c)" + tail), 123456789U);
  EXPECT_EQ(parseStartTime("17 (x) S 1 2 3"), std::nullopt);
  EXPECT_EQ(parseStartTime("17 sh S 1 2"), std::nullopt);
  EXPECT_EQ(parseStartTime("17 (x) S 1 2 3 4 5 6 7 8 9 10 11 12 13 14 15 16 17 18 12a 19"), std::nullopt);
}

// The connection path fails closed: a count that could not be read is a
// sandboxed peer; only a count above our own is, otherwise.
TEST(CountsAsSandboxed, AnUnreadableCountIsSandboxed) {
  const std::optional<uint64_t> ours = seccompFilterCount(::getpid());
  ASSERT_TRUE(ours.has_value());
  EXPECT_TRUE(countsAsSandboxed(std::nullopt));
  EXPECT_FALSE(countsAsSandboxed(*ours));
  EXPECT_TRUE(countsAsSandboxed(*ours + 1));
  if (*ours > 0) {
    EXPECT_FALSE(countsAsSandboxed(*ours - 1));
  }
}

}  // namespace
}  // namespace sandbox
