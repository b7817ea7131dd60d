#include "platform/dispatch/Semaphore.h"

#include <gtest/gtest.h>

#include <chrono>
#include <cstddef>
#include <thread>
#include <vector>

#include "platform/dispatch/ThreadPool.h"

namespace tn::dispatch {
namespace {

using std::chrono::milliseconds;

TEST(Semaphore, CountsSignalsAndWaits) {
  Semaphore semaphore(2);
  EXPECT_TRUE(semaphore.waitFor(milliseconds(0)));
  semaphore.wait();
  EXPECT_FALSE(semaphore.waitFor(milliseconds(0)));
  semaphore.signal();
  semaphore.signal();
  EXPECT_TRUE(semaphore.waitFor(milliseconds(0)));
  EXPECT_TRUE(semaphore.waitFor(milliseconds(0)));
  EXPECT_FALSE(semaphore.waitFor(milliseconds(0)));
}

TEST(Semaphore, WaitForTimesOutWithoutTakingAnything) {
  Semaphore semaphore;
  EXPECT_FALSE(semaphore.waitFor(milliseconds(20)));
  semaphore.signal();
  EXPECT_TRUE(semaphore.waitFor(milliseconds(20)));
  EXPECT_FALSE(semaphore.waitFor(milliseconds(1)));
}

TEST(Semaphore, EverySignalFromManyThreadsWakesOneWait) {
  Semaphore semaphore;
  constexpr int kProducers = 4;
  constexpr int kEach = 1000;
  std::vector<std::thread> producers;
  for (int p = 0; p < kProducers; ++p) {
    producers.emplace_back([&] {
      for (int i = 0; i < kEach; ++i) {
        semaphore.signal();
      }
    });
  }
  for (int i = 0; i < kProducers * kEach; ++i) {
    semaphore.wait();
  }
  for (auto& producer : producers) {
    producer.join();
  }
  EXPECT_FALSE(semaphore.waitFor(milliseconds(0)));
}

TEST(Semaphore, PoolWorkersWaitingOnItDoNotStarveThePool) {
  // More pool tasks wait at once than the pool has base workers; they are
  // only let go once all of them are waiting.
  ThreadPool pool(2, 16);
  const std::size_t tasks = 8;
  Semaphore arrived;
  Semaphore go;
  Semaphore finished;
  for (std::size_t i = 0; i < tasks; ++i) {
    pool.submit([&] {
      arrived.signal();
      go.wait();
      finished.signal();
    });
  }
  for (std::size_t i = 0; i < tasks; ++i) {
    arrived.wait();
  }
  for (std::size_t i = 0; i < tasks; ++i) {
    go.signal();
  }
  for (std::size_t i = 0; i < tasks; ++i) {
    finished.wait();
  }
  EXPECT_FALSE(finished.waitFor(milliseconds(0)));
}

}  // namespace
}  // namespace tn::dispatch
