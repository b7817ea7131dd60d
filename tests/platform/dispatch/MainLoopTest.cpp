#include "platform/dispatch/MainLoop.h"

#include <gtest/gtest.h>

#include <chrono>
#include <thread>
#include <vector>

#include "platform/dispatch/SerialQueue.h"
#include "platform/dispatch/ThreadPool.h"
#include "tests/platform/dispatch/TestSupport.h"

namespace tn::dispatch {
namespace {

using test::Gate;

// GoogleTest runs test bodies on the process's main thread, which therefore
// plays the daemon's main thread here. Each test leaves the main queue empty.

TEST(MainLoop, MainQueueIsASerialQueueNamedMain) {
  ASSERT_TRUE(MainLoop::isMainThread());
  EXPECT_EQ(mainQueue()->label(), "main");
  EXPECT_EQ(mainQueue().get(), mainQueue().get());
  std::thread other([] { EXPECT_FALSE(MainLoop::isMainThread()); });
  other.join();
}

TEST(MainLoop, RunsMainQueueBlocksOnTheMainThreadInOrder) {
  const auto mainThread = std::this_thread::get_id();
  std::vector<int> order;  // owned by the main queue
  bool allOnMain = true;
  std::thread producer([&] {
    for (int i = 0; i < 100; ++i) {
      mainQueue()->async([&, i] {
        mainQueue()->assertOnQueue();
        allOnMain = allOnMain && std::this_thread::get_id() == mainThread;
        order.push_back(i);
      });
    }
  });
  runMainLoopUntil([&] { return order.size() == 100; });
  producer.join();
  EXPECT_TRUE(allOnMain);
  for (int i = 0; i < 100; ++i) {
    ASSERT_EQ(order[static_cast<std::size_t>(i)], i);
  }
  EXPECT_FALSE(mainQueue()->isCurrent());
}

TEST(MainLoop, SyncOntoTheMainQueueFromAPoolThreadRunsOnTheCallerInQueueOrder) {
  const auto worker = SerialQueue::create("worker");
  std::vector<int> order;  // owned by the main queue
  std::thread::id syncRanOn;
  std::thread::id workerThread;
  bool finished = false;  // owned by the main queue
  worker->async([&] {
    workerThread = std::this_thread::get_id();
    mainQueue()->async([&] { order.push_back(1); });
    mainQueue()->sync([&] {
      mainQueue()->assertOnQueue();
      worker->assertOnQueue();
      syncRanOn = std::this_thread::get_id();
      order.push_back(2);
    });
    mainQueue()->async([&] {
      order.push_back(3);
      finished = true;
    });
  });
  runMainLoopUntil([&] { return finished; });
  worker->sync([] {});
  EXPECT_EQ(order, (std::vector<int>{1, 2, 3}));
  EXPECT_EQ(syncRanOn, workerThread);
  EXPECT_NE(syncRanOn, std::this_thread::get_id());
}

TEST(MainLoop, MainThreadMaySyncOntoAnIdleMainQueue) {
  const int value = mainQueue()->sync([] {
    mainQueue()->assertOnQueue();
    return 9;
  });
  EXPECT_EQ(value, 9);
}

TEST(MainLoop, MainThreadMaySyncOntoTheMainQueueHeldByAnotherThreadsSync) {
  // The holder hands the queue straight to the main thread; no block needs
  // the loop, so waiting is fine.
  Gate held;
  Gate release;
  std::vector<int> order;  // owned by the main queue
  std::thread holder([&] {
    mainQueue()->sync([&] {
      held.open();
      release.wait();
      order.push_back(1);
    });
  });
  held.wait();
  std::thread releaser([&] {
    // Once the main thread waits behind the holder.
    while (mainQueue()->pendingCount() != 1) {
      std::this_thread::yield();
    }
    release.open();
  });
  mainQueue()->sync([&] { order.push_back(2); });
  holder.join();
  releaser.join();
  EXPECT_EQ(order, (std::vector<int>{1, 2}));
}

TEST(MainLoop, RunOnceRunsOneTaskOrTimesOut) {
  EXPECT_FALSE(runMainLoopOnce(std::chrono::milliseconds(5)));
  int ran = 0;
  mainQueue()->async([&] { ++ran; });
  EXPECT_TRUE(runMainLoopOnce(std::chrono::milliseconds(0)));
  EXPECT_EQ(ran, 1);
  EXPECT_FALSE(runMainLoopOnce(std::chrono::milliseconds(0)));
}

TEST(MainLoop, OtherQueuesMayTargetTheMainLoop) {
  const auto ui = SerialQueue::create("ui", 33, MainLoop::shared());
  const auto mainThread = std::this_thread::get_id();
  bool ranOnMain = false;
  bool done = false;
  ui->async([&] {
    ranOnMain = std::this_thread::get_id() == mainThread && ui->isCurrent();
    done = true;
  });
  runMainLoopUntil([&] { return done; });
  EXPECT_TRUE(ranOnMain);
  EXPECT_EQ(ui->qualityOfService(), 33);
}

}  // namespace
}  // namespace tn::dispatch
