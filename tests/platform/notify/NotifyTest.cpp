// Named notifications: the count of posts, names, and observers that see
// posts from this and other processes exactly once each.

#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <future>
#include <mutex>
#include <sstream>
#include <thread>
#include <vector>

#include "platform/dispatch/SerialQueue.h"
#include "platform/notify/Notify.h"

namespace notify {
namespace {

using tn::dispatch::SerialQueue;

constexpr std::string_view kName = "com.ostrel.tenon.test-changed";

// Counts handler calls; waits for a count with a generous deadline so that
// a lost notification fails the test instead of hanging it.
class CallCounter {
 public:
  void increment() {
    const std::lock_guard lock(mutex_);
    ++count_;
    changed_.notify_all();
  }
  bool waitFor(uint64_t target) {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, std::chrono::seconds(30), [&] { return count_ >= target; });
  }
  uint64_t count() const {
    const std::lock_guard lock(mutex_);
    return count_;
  }

 private:
  mutable std::mutex mutex_;
  std::condition_variable changed_;
  uint64_t count_ = 0;
};

class Notify : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string pattern = "/tmp/tenon-notify-XXXXXX";
    ASSERT_NE(::mkdtemp(pattern.data()), nullptr);
    root_ = pattern;
    ASSERT_EQ(::setenv("TENON_ROOT", root_.c_str(), 1), 0);
  }
  void TearDown() override {
    ::unsetenv("TENON_ROOT");
    std::filesystem::remove_all(root_);
  }

  std::string fileOf(std::string_view name) const { return root_ + "/run/tenon/notify/" + std::string(name); }

  std::unique_ptr<Observer> observe(std::string_view name, const std::shared_ptr<SerialQueue>& queue,
                                    CallCounter& calls) {
    auto observer = Observer::create(name, queue, [queue, &calls] {
      queue->assertOnQueue();
      calls.increment();
    });
    EXPECT_TRUE(observer) << observer.error().description();
    return observer ? std::move(observer).value() : nullptr;
  }

  // Forks a process that posts name `times` times and waits for it.
  static void postFromAnotherProcess(std::string_view name, int times) {
    const pid_t pid = ::fork();
    if (pid == 0) {
      for (int i = 0; i < times; ++i) {
        if (!post(name)) ::_exit(1);
      }
      ::_exit(0);
    }
    int status = 0;
    ASSERT_EQ(::waitpid(pid, &status, 0), pid);
    ASSERT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  }

  std::string root_;
};

TEST_F(Notify, PostsAreCounted) {
  EXPECT_EQ(*postCount(kName), 0U);
  EXPECT_FALSE(std::filesystem::exists(fileOf(kName)));  // reading creates nothing
  EXPECT_EQ(*post(kName), 1U);
  EXPECT_EQ(*post(kName), 2U);
  EXPECT_EQ(*postCount(kName), 2U);
  EXPECT_EQ(*postCount("com.ostrel.tenon.other"), 0U);

  std::ifstream file(fileOf(kName));
  std::stringstream contents;
  contents << file.rdbuf();
  EXPECT_EQ(contents.str(), "00000000000000000002\n");  // one fixed-width record
}

TEST_F(Notify, OlderAndLongerTextsReadUpToTheirFirstLine) {
  ASSERT_TRUE(post(kName));
  std::ofstream(fileOf(kName), std::ofstream::trunc) << "41\n";  // the earlier format
  EXPECT_EQ(*postCount(kName), 41U);
  EXPECT_EQ(*post(kName), 42U);
  std::ofstream(fileOf(kName), std::ofstream::trunc) << "7\n" << std::string(100, 'x');
  EXPECT_EQ(*postCount(kName), 7U);
  EXPECT_EQ(*post(kName), 8U);
  EXPECT_EQ(std::filesystem::file_size(fileOf(kName)), 21U) << "cut back to one record";
}

// flock needs only read access, which every user has: a peer holding an
// exclusive lock on the file must not stall posts or reads.
TEST_F(Notify, AnotherDescriptionsLockDoesNotStallPostsOrReads) {
  ASSERT_TRUE(post(kName));
  const int peer = ::open(fileOf(kName).c_str(), O_RDONLY | O_CLOEXEC);
  ASSERT_GE(peer, 0);
  ASSERT_EQ(::flock(peer, LOCK_EX), 0);
  auto posted = std::async(std::launch::async, [] { return post(kName).ok() && postCount(kName).ok(); });
  const bool finished = posted.wait_for(std::chrono::seconds(30)) == std::future_status::ready;
  ::close(peer);  // lets a stalled post finish, so the test ends either way
  EXPECT_TRUE(finished) << "post waited on a lock a peer held";
  EXPECT_TRUE(posted.get());
  EXPECT_EQ(*postCount(kName), 2U);
}

TEST_F(Notify, FilesAndDirectoriesGetTheirModesWhateverTheUmask) {
  const mode_t previous = ::umask(077);
  const tn::Result<uint64_t> posted = post(kName);
  ::umask(previous);
  ASSERT_TRUE(posted);
  struct stat status {};
  ASSERT_EQ(::stat(fileOf(kName).c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0644U);
  for (const char* directory : {"/run", "/run/tenon", "/run/tenon/notify"}) {
    ASSERT_EQ(::stat((root_ + directory).c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777, 0755U) << directory;
  }
}

TEST_F(Notify, FileWithoutACounterStartsOver) {
  ASSERT_TRUE(post(kName));
  std::ofstream(fileOf(kName), std::ofstream::trunc) << "garbage\n";
  EXPECT_EQ(*postCount(kName), 0U);
  EXPECT_EQ(*post(kName), 1U);
  std::ofstream(fileOf(kName), std::ofstream::trunc) << "99999999999999999999999\n";  // beyond 64 bits
  EXPECT_EQ(*postCount(kName), 0U);
}

TEST_F(Notify, ConcurrentPostsFromManyThreadsEachCountOnce) {
  constexpr int kThreads = 4;
  constexpr int kPostsEach = 200;
  std::vector<std::thread> threads;
  std::atomic<int> failures{0};
  for (int i = 0; i < kThreads; ++i) {
    threads.emplace_back([&] {
      for (int j = 0; j < kPostsEach; ++j) {
        if (!post(kName)) ++failures;
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(failures.load(), 0);
  EXPECT_EQ(*postCount(kName), static_cast<uint64_t>(kThreads * kPostsEach));
}

// The poster's processes serialise on a lock file of their own (mode 0600),
// so posts from several processes at once each count exactly once too.
TEST_F(Notify, ConcurrentPostsFromManyProcessesEachCountOnce) {
  constexpr int kProcesses = 4;
  constexpr int kPostsEach = 50;
  std::vector<pid_t> children;
  for (int i = 0; i < kProcesses; ++i) {
    const pid_t pid = ::fork();
    if (pid == 0) {
      for (int j = 0; j < kPostsEach; ++j) {
        if (!post(kName)) ::_exit(1);
      }
      ::_exit(0);
    }
    children.push_back(pid);
  }
  for (const pid_t pid : children) {
    int status = 0;
    ASSERT_EQ(::waitpid(pid, &status, 0), pid);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  }
  EXPECT_EQ(*postCount(kName), static_cast<uint64_t>(kProcesses * kPostsEach));
  struct stat status {};
  ASSERT_EQ(::stat((root_ + "/run/tenon/notify/." + std::string(kName) + ".lock").c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0600U) << "nobody else can open the lock file";
}

// A lock file another user could open is not used: a peer holding it does
// not stall the post.
TEST_F(Notify, ALockFileOthersCanOpenIsIgnored) {
  ASSERT_TRUE(post(kName));
  const std::string lockFile = root_ + "/run/tenon/notify/." + std::string(kName) + ".lock";
  ASSERT_EQ(::chmod(lockFile.c_str(), 0644), 0);
  const int peer = ::open(lockFile.c_str(), O_RDONLY | O_CLOEXEC);
  ASSERT_GE(peer, 0);
  ASSERT_EQ(::flock(peer, LOCK_EX), 0);
  auto posted = std::async(std::launch::async, [] { return post(kName).ok(); });
  const bool finished = posted.wait_for(std::chrono::seconds(30)) == std::future_status::ready;
  ::close(peer);
  EXPECT_TRUE(finished) << "post waited on a lock file others can open";
  EXPECT_TRUE(posted.get());
  EXPECT_EQ(*postCount(kName), 2U);
}

TEST_F(Notify, InvalidNamesAreRefused) {
  const auto queue = SerialQueue::create("notify-test");
  for (const std::string_view name : {std::string_view(""), std::string_view("/"), std::string_view(".."),
                                      std::string_view("."), std::string_view("a/b"),
                                      std::string_view("../escape"), std::string_view("a\0b", 3)}) {
    for (const tn::Error& error : {post(name).error(), postCount(name).error(),
                                   Observer::create(name, queue, [] {}).error()}) {
      EXPECT_EQ(error.domain(), kNotifyErrorDomain);
      EXPECT_EQ(error.code(), static_cast<int64_t>(NotifyErrorCode::InvalidName));
    }
  }
  EXPECT_FALSE(post(std::string(256, 'n')));
  EXPECT_TRUE(post(std::string(255, 'n')));
  EXPECT_FALSE(std::filesystem::exists(root_ + "/escape"));
}

TEST_F(Notify, ObserverSeesEveryPostOfAnotherProcessOnce) {
  ASSERT_TRUE(post(kName));  // before the observer: not delivered
  const auto queue = SerialQueue::create("notify-observer");
  CallCounter calls;
  const auto observer = observe(kName, queue, calls);
  ASSERT_TRUE(observer);

  postFromAnotherProcess(kName, 3);
  ASSERT_TRUE(calls.waitFor(3));
  // One more from here; once it is delivered no earlier post can still be
  // on its way, so the count is exact.
  ASSERT_TRUE(post(kName));
  ASSERT_TRUE(calls.waitFor(4));
  queue->sync([] {});
  EXPECT_EQ(calls.count(), 4U);
  EXPECT_EQ(*postCount(kName), 5U);
}

TEST_F(Notify, ObserversOfOtherNamesSeeNothing) {
  const auto queue = SerialQueue::create("notify-observer");
  CallCounter mine;
  CallCounter other;
  const auto observer = observe(kName, queue, mine);
  const auto otherObserver = observe("com.ostrel.tenon.other", queue, other);
  ASSERT_TRUE(post("com.ostrel.tenon.other"));
  ASSERT_TRUE(post(kName));
  ASSERT_TRUE(mine.waitFor(1));
  ASSERT_TRUE(other.waitFor(1));
  queue->sync([] {});
  EXPECT_EQ(mine.count(), 1U);
  EXPECT_EQ(other.count(), 1U);
}

TEST_F(Notify, RemovedFileStartsCountingAgain) {
  const auto queue = SerialQueue::create("notify-observer");
  CallCounter calls;
  const auto observer = observe(kName, queue, calls);
  ASSERT_TRUE(post(kName));
  ASSERT_TRUE(post(kName));
  ASSERT_TRUE(calls.waitFor(2));
  std::filesystem::remove(fileOf(kName));
  ASSERT_TRUE(post(kName));
  ASSERT_TRUE(calls.waitFor(3));
  ASSERT_TRUE(post(kName));
  ASSERT_TRUE(calls.waitFor(4));
  queue->sync([] {});
  EXPECT_EQ(calls.count(), 4U);
}

TEST_F(Notify, ObserverMayBeDestroyedFromItsOwnHandler) {
  const auto queue = SerialQueue::create("notify-observer");
  CallCounter calls;
  std::unique_ptr<Observer> observer;
  auto created = Observer::create(kName, queue, [&] {
    calls.increment();
    observer.reset();
  });
  ASSERT_TRUE(created);
  queue->sync([&] { observer = std::move(created).value(); });
  ASSERT_TRUE(post(kName));
  ASSERT_TRUE(calls.waitFor(1));
  queue->sync([&] { EXPECT_EQ(observer, nullptr); });
}

}  // namespace
}  // namespace notify
