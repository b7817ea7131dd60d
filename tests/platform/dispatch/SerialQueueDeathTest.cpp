// Programming errors that must abort with a message instead of hanging.

#include <gtest/gtest.h>

#include <chrono>
#include <stdexcept>
#include <thread>

#include "platform/dispatch/MainLoop.h"
#include "platform/dispatch/Semaphore.h"
#include "platform/dispatch/SerialQueue.h"

namespace tn::dispatch {
namespace {

class SerialQueueDeathTest : public ::testing::Test {
 protected:
  void SetUp() override { GTEST_FLAG_SET(death_test_style, "threadsafe"); }
};

// Blocks the test thread until the process dies; for aborts on pool threads.
[[noreturn]] void waitForever() {
  Semaphore never;
  for (;;) {
    never.wait();
  }
}

TEST_F(SerialQueueDeathTest, SyncOntoItsOwnQueueFromAnAsyncBlockAborts) {
  EXPECT_DEATH(
      {
        const auto queue = SerialQueue::create("self");
        queue->async([&] { queue->sync([] {}); });
        waitForever();
      },
      "tenon: fatal: sync onto queue 'self' from a block running on it would deadlock");
}

TEST_F(SerialQueueDeathTest, SyncOntoItsOwnQueueFromASyncBlockAborts) {
  EXPECT_DEATH(
      {
        const auto queue = SerialQueue::create("self-sync");
        queue->sync([&] { queue->sync([] {}); });
      },
      "tenon: fatal: sync onto queue 'self-sync' from a block running on it would deadlock");
}

TEST_F(SerialQueueDeathTest, SyncBackOntoAnOuterQueueOfANestedSyncAborts) {
  // A -> B is fine (SerialQueueTest covers it); B -> A inside it waits on A,
  // which this very thread holds.
  EXPECT_DEATH(
      {
        const auto a = SerialQueue::create("A");
        const auto b = SerialQueue::create("B");
        a->async([&] { b->sync([&] { a->sync([] {}); }); });
        waitForever();
      },
      "tenon: fatal: sync onto queue 'A' from a block running on it would deadlock");
}

TEST_F(SerialQueueDeathTest, ASyncAgainstTheLockOrderAbortsOnFirstUseNamingBothQueues) {
  if (!SerialQueue::checksLockOrder()) GTEST_SKIP() << "this build does not check the lock order";
  const auto service = SerialQueue::create("service");
  service->setLockRank(10);
  const auto leaf = SerialQueue::create("leaf");
  leaf->setLockRank(20);
  const auto otherLeaf = SerialQueue::create("other-leaf");
  otherLeaf->setLockRank(20);
  const auto unranked = SerialQueue::create("unranked");
  // In order, and through unranked queues, all is well.
  service->sync([&] { leaf->sync([] {}); });
  unranked->sync([&] { leaf->sync([&] { unranked->async([] {}); }); });
  EXPECT_DEATH(leaf->sync([&] { service->sync([] {}); }),
               "tenon: fatal: lock order: sync onto queue 'service' \\(rank 10\\) from a thread holding "
               "queue 'leaf' \\(rank 20\\)");
  EXPECT_DEATH(leaf->sync([&] { otherLeaf->sync([] {}); }), "lock order: sync onto queue 'other-leaf'");
}

TEST_F(SerialQueueDeathTest, AssertOnQueueOffAnyQueueAborts) {
  EXPECT_DEATH(SerialQueue::create("TNDatabase")->assertOnQueue(),
               "tenon: fatal: assertion failed: not running on queue 'TNDatabase' "
               "\\(not running on any queue\\)");
}

TEST_F(SerialQueueDeathTest, AssertOnQueueFromAnotherQueueAbortsNamingBoth) {
  EXPECT_DEATH(
      {
        const auto wanted = SerialQueue::create("serverSync");
        const auto running = SerialQueue::create("service");
        running->async([&] { wanted->assertOnQueue(); });
        waitForever();
      },
      "tenon: fatal: assertion failed: not running on queue 'serverSync' "
      "\\(running on queue 'service'\\)");
}

TEST_F(SerialQueueDeathTest, AnAsyncBlockThatThrowsAborts) {
  EXPECT_DEATH(
      {
        const auto queue = SerialQueue::create("thrower");
        queue->async([] { throw std::runtime_error("boom"); });
        waitForever();
      },
      "tenon: fatal: block on queue 'thrower' threw an exception: boom");
}

TEST_F(SerialQueueDeathTest, ASyncBlockThatThrowsAborts) {
  EXPECT_DEATH(SerialQueue::create("sync-thrower")->sync([]() -> int { throw 3; }),
               "tenon: fatal: block on queue 'sync-thrower' threw an exception "
               "\\(blocks must not throw\\)");
}

TEST_F(SerialQueueDeathTest, MainThreadSyncOntoABusyMainQueueAborts) {
  ASSERT_TRUE(MainLoop::isMainThread());
  EXPECT_DEATH(
      {
        mainQueue()->async([] {});
        mainQueue()->sync([] {});
      },
      "tenon: fatal: sync onto queue 'main' from the thread that runs it, outside its loop, "
      "would deadlock");
}

TEST_F(SerialQueueDeathTest, SyncOntoTheMainQueueFromAMainQueueBlockAborts) {
  EXPECT_DEATH(
      {
        mainQueue()->async([] { mainQueue()->sync([] {}); });
        runMainLoop();
      },
      "tenon: fatal: sync onto queue 'main' from a block running on it would deadlock");
}

TEST_F(SerialQueueDeathTest, RunningTheMainLoopOffTheMainThreadAborts) {
  EXPECT_DEATH(
      {
        std::thread other([] { runMainLoopOnce(std::chrono::milliseconds(0)); });
        other.join();
      },
      "tenon: fatal: runMainLoopOnce called off the main thread");
}

TEST_F(SerialQueueDeathTest, RunningTheMainLoopFromInsideItAborts) {
  EXPECT_DEATH(
      {
        mainQueue()->async([] { runMainLoopUntil([] { return true; }); });
        runMainLoop();
      },
      "tenon: fatal: runMainLoopUntil called from inside the main loop");
}

TEST_F(SerialQueueDeathTest, ANegativeSemaphoreCountAborts) {
  EXPECT_DEATH(Semaphore(-1), "tenon: fatal: Semaphore created with a negative count");
}

}  // namespace
}  // namespace tn::dispatch
