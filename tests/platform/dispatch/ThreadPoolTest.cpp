#include "platform/dispatch/ThreadPool.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <poll.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstdlib>
#include <cstddef>
#include <memory>
#include <thread>
#include <vector>

#include "tests/platform/dispatch/TestSupport.h"

namespace tn::dispatch {
namespace {

using test::Counter;
using test::Gate;
using test::eventually;

TEST(ThreadPool, RunsEveryTaskOnAPoolThreadWithoutExceedingBaseWhenNobodyBlocks) {
  ThreadPool pool(2, 8);
  constexpr int kTasks = 200;
  Counter done;
  std::atomic<int> offPool{0};
  std::atomic<std::size_t> mostThreads{0};
  for (int i = 0; i < kTasks; ++i) {
    pool.submit([&] {
      if (ThreadPool::current() != &pool) {
        offPool.fetch_add(1);
      }
      const std::size_t threads = pool.counts().threads;
      std::size_t seen = mostThreads.load();
      while (threads > seen && !mostThreads.compare_exchange_weak(seen, threads)) {
      }
      done.increment();
    });
  }
  done.waitFor(kTasks);
  EXPECT_EQ(offPool.load(), 0);
  EXPECT_LE(mostThreads.load(), 2u);
  EXPECT_EQ(ThreadPool::current(), nullptr);
}

TEST(ThreadPool, BusyWorkersThatDoNotDeclareBlockingGetNoHelpers) {
  ThreadPool pool(2, 8);
  Gate release;
  Counter running;
  Counter done;
  for (int i = 0; i < 2; ++i) {
    pool.submit([&] {
      running.increment();
      release.wait();  // busy, as far as the pool knows
      done.increment();
    });
  }
  running.waitFor(2);
  pool.submit([&] { done.increment(); });
  const ThreadPool::Counts counts = pool.counts();
  EXPECT_EQ(counts.threads, 2u);
  EXPECT_EQ(counts.pending, 1u);
  release.open();
  done.waitFor(3);
}

TEST(ThreadPool, StartsExtraWorkersWhileWorkersBlockAndRetiresThemAfterwards) {
  // Every task waits until all of them run at once: only possible if the pool
  // grows past its base of 2 because the waiting workers declare it.
  ThreadPool pool(2, 16);
  constexpr std::size_t kTasks = 8;
  Counter arrived;
  Counter done;
  for (std::size_t i = 0; i < kTasks; ++i) {
    pool.submit([&] {
      arrived.increment();
      {
        const ThreadPool::BlockingScope blocking;
        arrived.waitFor(kTasks);
      }
      done.increment();
    });
  }
  done.waitFor(kTasks);
  EXPECT_TRUE(eventually([&] { return pool.counts().threads <= pool.baseThreadCount(); }))
      << "threads still alive: " << pool.counts().threads;
  EXPECT_EQ(pool.counts().blocked, 0u);
}

TEST(ThreadPool, NeverStartsMoreThanItsCap) {
  ThreadPool pool(1, 3);
  Gate release;
  Counter arrived;
  Counter done;
  for (int i = 0; i < 5; ++i) {
    pool.submit([&] {
      arrived.increment();
      {
        const ThreadPool::BlockingScope blocking;
        release.wait();
      }
      done.increment();
    });
  }
  arrived.waitFor(3);
  const ThreadPool::Counts counts = pool.counts();
  EXPECT_EQ(counts.threads, 3u);
  EXPECT_EQ(counts.pending, 2u);  // the last two wait for a worker to come back
  release.open();
  done.waitFor(5);
}

TEST(ThreadPool, NestedBlockingScopesCountOnce) {
  ThreadPool pool(1, 4);
  Gate inside;
  Gate release;
  pool.submit([&] {
    const ThreadPool::BlockingScope outer;
    {
      const ThreadPool::BlockingScope inner;
      inside.open();
      release.wait();
    }
  });
  inside.wait();
  EXPECT_EQ(pool.counts().blocked, 1u);
  release.open();
}

TEST(ThreadPool, BlockingScopeOffThePoolDoesNothing) {
  ThreadPool pool(1, 2);
  ASSERT_EQ(ThreadPool::current(), nullptr);
  const ThreadPool::BlockingScope blocking;
  EXPECT_EQ(pool.counts().blocked, 0u);
  EXPECT_EQ(ThreadPool::shared().counts().blocked, 0u);
}

TEST(ThreadPool, DestructorRunsWhatIsStillQueued) {
  std::atomic<int> ran{0};
  {
    ThreadPool pool(1, 1);
    Gate release;
    pool.submit([&] { release.wait(); });
    for (int i = 0; i < 50; ++i) {
      pool.submit([&] { ran.fetch_add(1); });
    }
    release.open();
  }
  EXPECT_EQ(ran.load(), 50);
}

TEST(ThreadPoolDeathTest, ProcessExitDoesNotWaitForWorkersThatNeverFinish) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(
      {
        ThreadPool& pool = ThreadPool::shared();
        Gate never;
        Counter started;
        for (std::size_t i = 0; i < pool.baseThreadCount() + 2; ++i) {
          pool.submit([&] {
            started.increment();
            const ThreadPool::BlockingScope blocking;
            never.wait();
          });
        }
        started.waitFor(pool.baseThreadCount() + 2);
        pool.submit([] {});  // may be abandoned
        std::exit(3);
      },
      ::testing::ExitedWithCode(3), "");
}

TEST(ThreadPoolDeathTest, ProcessExitWithIdleWorkersIsClean) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(
      {
        Counter done;
        for (int i = 0; i < 100; ++i) {
          ThreadPool::shared().submit([&] { done.increment(); });
        }
        done.waitFor(100);
        std::exit(4);
      },
      ::testing::ExitedWithCode(4), "");
}

TEST(ThreadPool, SharedPoolHasAtLeastTwoBaseWorkersAndRoomToGrow) {
  ThreadPool& pool = ThreadPool::shared();
  EXPECT_EQ(&pool, &ThreadPool::shared());
  EXPECT_GE(pool.baseThreadCount(), 2u);
  EXPECT_GE(pool.baseThreadCount(), std::thread::hardware_concurrency());
  EXPECT_GE(pool.maxThreadCount(), 64u);
}

}  // namespace
}  // namespace tn::dispatch

namespace tn::dispatch {
namespace {

// An event source for the pool's idle workers to wait in: events are bytes
// written to a pipe; each runs `onEvent` on the thread that waited.
class PipePoller final : public Poller {
 public:
  PipePoller() {
    if (::pipe2(events_, O_CLOEXEC) != 0 || ::pipe2(wakeups_, O_CLOEXEC | O_NONBLOCK) != 0) std::abort();
  }
  ~PipePoller() override {
    for (int fd : {events_[0], events_[1], wakeups_[0], wakeups_[1]}) ::close(fd);
  }
  void post() {
    const char byte = 1;
    if (::write(events_[1], &byte, 1) != 1) std::abort();
  }
  void pollOnce() override {
    pollfd fds[2] = {{events_[0], POLLIN, 0}, {wakeups_[0], POLLIN, 0}};
    if (::poll(fds, 2, -1) <= 0) return;
    if (fds[1].revents != 0) {
      char drain[64];
      while (::read(wakeups_[0], drain, sizeof drain) > 0) {
      }
      return;
    }
    char byte;
    if (::read(events_[0], &byte, 1) == 1) onEvent();
  }
  void interrupt() override {
    const char byte = 1;
    (void)!::write(wakeups_[1], &byte, 1);
  }
  std::function<void()> onEvent;

 private:
  int events_[2];
  int wakeups_[2];
};

TEST(ThreadPoolPoller, TheWorkerAnEventWokeRunsTheWorkItQueued) {
  // The poller and everything the tasks use outlive the pool.
  PipePoller poller;
  Counter done;
  std::atomic<std::thread::id> eventThread, firstHop, secondHop;
  ThreadPool pool(2, 4);
  poller.onEvent = [&] {
    eventThread = std::this_thread::get_id();
    pool.submit([&] {
      firstHop = std::this_thread::get_id();
      pool.submit([&] {  // a chain of hand-offs, as between serial queues
        secondHop = std::this_thread::get_id();
        done.increment();
      });
    });
  };
  pool.setPoller(&poller);
  EXPECT_EQ(pool.counts().threads, 1u) << "one worker waits for events; none is needed for tasks yet";
  int sameThread = 0;
  constexpr int kEvents = 50;
  for (int i = 1; i <= kEvents; ++i) {
    poller.post();
    done.waitFor(static_cast<std::size_t>(i));
    if (eventThread.load() == firstHop.load() && firstHop.load() == secondHop.load()) ++sameThread;
  }
  // The pool grows to its base once; after that each event's work stays on
  // the thread the event woke.
  EXPECT_GE(sameThread, kEvents - 2);
  EXPECT_LE(pool.counts().threads, 2u);
}

TEST(ThreadPoolPoller, AWorkerThatBlocksLeavesTheWaitingForEventsToAnother) {
  PipePoller poller;
  Gate release;
  Counter events;
  std::atomic<bool> first{true};
  ThreadPool pool(2, 4);
  poller.onEvent = [&] {
    events.increment();
    if (!first.exchange(false)) return;
    pool.submit([&] {
      const ThreadPool::BlockingScope blocking;
      release.wait();  // holds this worker until the second event came
    });
  };
  pool.setPoller(&poller);
  poller.post();
  events.waitFor(1);
  poller.post();
  events.waitFor(2);  // hangs if nobody waits for events while a worker blocks
  release.open();
}

// A pool of two workers whose poller counts its events, and a task held
// until the test lets it go: whether an event is handled while a worker is
// busy with it. Members go in reverse: the pool first.
struct PoolWithAHeldTask {
  PipePoller poller;
  Gate release;
  Counter started, events;
  ThreadPool pool{2, 4};

  PoolWithAHeldTask() { poller.onEvent = [this] { events.increment(); }; }
  // Submits the held task (saying first that it runs long, when asked) and
  // waits until it runs.
  void startHeldTask(bool saysItRunsLong) {
    pool.submit([this, saysItRunsLong] {
      if (saysItRunsLong) ThreadPool::willRunLongTask();
      started.increment();
      release.wait();
    });
    started.waitFor(1);
  }
  // Posts an event; whether it was handled before the task was let go.
  bool eventHandledWhileHeld() {
    poller.post();
    const bool handled = eventually([this] { return events.value() == 1; }, std::chrono::seconds(10));
    release.open();
    return handled;
  }
};

// A task that says it will run long, taken by the worker that was waiting
// for events, leaves the waiting to another: events are handled while it
// runs (a registrar scan while clients connect).
TEST(ThreadPoolPoller, ALongTaskLeavesTheWaitingForEventsToAnother) {
  PoolWithAHeldTask busy;
  busy.pool.setPoller(&busy.poller);
  ASSERT_TRUE(eventually([&] {
    const ThreadPool::Counts counts = busy.pool.counts();
    return counts.threads == 1 && counts.idle == 1;
  })) << "the one worker never waited for events";
  busy.startHeldTask(true);  // the only worker leaves the poller for it
  EXPECT_TRUE(busy.eventHandledWhileHeld()) << "the event waited for the long task";
}

// The poller given to a pool whose only worker is busy gets a worker of its
// own at once, not when the task ends.
TEST(ThreadPoolPoller, APollerGivenWhileEveryWorkerIsBusyGetsAWorker) {
  PoolWithAHeldTask busy;
  busy.startHeldTask(false);
  busy.pool.setPoller(&busy.poller);
  EXPECT_TRUE(busy.eventHandledWhileHeld()) << "nobody waited for events while the task ran";
}

TEST(ThreadPoolPoller, WorkSubmittedFromOutsideReachesAWorkerWaitingInThePoller) {
  PipePoller poller;
  Counter done;
  ThreadPool pool(1, 1);
  pool.setPoller(&poller);
  for (int i = 1; i <= 20; ++i) {
    pool.submit([&] { done.increment(); });  // the only worker sits in pollOnce()
    done.waitFor(static_cast<std::size_t>(i));
  }
}

TEST(ThreadPoolDeathTest, APoolAtItsCapWhoseWorkersAllWaitSaysWhatTheyWaitFor) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(
      {
        ThreadPool pool(1, 1, std::chrono::milliseconds(100));
        Gate never;
        pool.submit([&] {
          const ThreadPool::BlockingScope blocking("the gate of the test");
          never.wait();
        });
        pool.submit([] {});  // can never run
        std::this_thread::sleep_for(std::chrono::seconds(10));
        std::exit(0);
      },
      "thread pool stalled: all 1 workers.*\\[the gate of the test\\]");
}

}  // namespace
}  // namespace tn::dispatch
