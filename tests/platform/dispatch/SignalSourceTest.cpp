#include "platform/dispatch/SignalSource.h"

#include <gtest/gtest.h>

#include <unistd.h>

#include <atomic>
#include <chrono>

#include "platform/dispatch/Semaphore.h"

namespace tn::dispatch {
namespace {

// Runs in a freshly started child (a "threadsafe" death test), which is still
// single threaded when the signal is blocked, as in tenond's main.
[[noreturn]] void deliverTwoSignalsToAQueue() {
  SignalSource::blockInAllThreads(SIGUSR1);
  auto queue = SerialQueue::create("signals");
  Semaphore arrived;
  std::atomic<int> count{0};
  static auto source = SignalSource::create(SIGUSR1, queue, [&] {
    queue->assertOnQueue();
    ++count;
    arrived.signal();
  });
  for (int i = 0; i < 2; ++i) {
    kill(getpid(), SIGUSR1);
    if (!arrived.waitFor(std::chrono::seconds(10))) _exit(3);
  }
  // Still alive: the default action (termination) never happened.
  _exit(count == 2 ? 0 : 4);
}

TEST(SignalSource, DeliversEachSignalAsABlockOnTheQueueInsteadOfItsDefaultAction) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(deliverTwoSignalsToAQueue(), ::testing::ExitedWithCode(0), "");
}

}  // namespace
}  // namespace tn::dispatch
