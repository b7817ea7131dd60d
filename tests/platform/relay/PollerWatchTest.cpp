// Waiting on the I/O poller: a pidfd's watch runs its block once the
// process exits, a timer after its delay, and a cancelled watch never.

#include "platform/relay/PollerWatch.h"

#include <gtest/gtest.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>

#include "platform/relay/UniqueFd.h"
#include "tests/platform/relay/RelayTestSupport.h"

namespace relay {
namespace {

using test::eventually;

TEST(PollerWatch, RunsOnTheQueueWhenTheWatchedProcessExits) {
  int release[2];
  ASSERT_EQ(::pipe(release), 0);
  const pid_t child = ::fork();
  if (child == 0) {
    ::close(release[1]);
    char byte;
    [[maybe_unused]] const ssize_t n = ::read(release[0], &byte, 1);
    ::_exit(0);
  }
  ::close(release[0]);
  const UniqueFd pidfd(static_cast<int>(::syscall(SYS_pidfd_open, child, 0)));
  ASSERT_TRUE(pidfd.valid());
  const auto queue = tn::dispatch::SerialQueue::create("watch");
  std::atomic<int> runs{0};
  std::atomic<bool> onQueue{false};
  const auto watch = PollerWatch::whenReadable(pidfd.get(), queue, [&] {
    onQueue = queue->isCurrent();
    ++runs;
  });
  ASSERT_TRUE(watch);
  queue->sync([] {});
  EXPECT_EQ(runs, 0);  // still running
  ::close(release[1]);
  EXPECT_TRUE(eventually([&] { return runs == 1; }));
  EXPECT_TRUE(onQueue);
  ::waitpid(child, nullptr, 0);
}

TEST(PollerWatch, ACancelledTimerNeverRuns) {
  const auto queue = tn::dispatch::SerialQueue::create("timer");
  std::atomic<int> cancelledRuns{0};
  std::atomic<int> runs{0};
  auto cancelled = PollerWatch::after(std::chrono::milliseconds(20), queue, [&] { ++cancelledRuns; });
  cancelled->cancel();
  const auto kept = PollerWatch::after(std::chrono::milliseconds(40), queue, [&] { ++runs; });
  EXPECT_TRUE(eventually([&] { return runs == 1; }));
  queue->sync([] {});
  EXPECT_EQ(cancelledRuns, 0);  // the later timer fired, so the earlier one's time had passed
}

}  // namespace
}  // namespace relay
