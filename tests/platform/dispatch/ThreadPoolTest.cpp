#include "platform/dispatch/ThreadPool.h"

#include <gtest/gtest.h>

#include <atomic>
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
