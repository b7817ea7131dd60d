// The idle-exit watcher on its own: it sleeps until work ends
// (relay::activityEnded) instead of asking again and again, so each case
// checks that the right end wakes it, and that no end makes it go while
// something is still busy. The watcher's answers to `isIdle` are counted,
// so that the tests wait for what it has seen rather than for time.

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <thread>

#include "platform/dispatch/MainLoop.h"
#include "platform/relay/KeepAlive.h"
#include "tenond/server/IdleExit.h"

namespace tnd {
namespace {

using std::chrono::milliseconds;

class IdleExitWatch : public ::testing::Test {
 protected:
  std::unique_ptr<IdleExit> start(milliseconds limit) {
    IdleExit::Actions actions;
    actions.isIdle = [this] {
      const bool idle = !busy;
      ++questions;
      return idle;
    };
    actions.stopAccepting = [this] {
      stopped = true;
      if (clientArrivesAsItStops) busy = true;
    };
    actions.exit = [this] {
      exited = true;
      exitedWhileBusy = busy.load();
    };
    return IdleExit::start(limit, std::move(actions));
  }

  // Until the watcher has answered `count` questions (at most 10 s).
  bool asked(int count) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while (questions < count) {
      if (std::chrono::steady_clock::now() > deadline) return false;
      std::this_thread::yield();
    }
    return true;
  }

  // Runs the main queue until `flag` is set (at most 10 s).
  static bool happens(const std::atomic<bool>& flag) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while (!flag && std::chrono::steady_clock::now() < deadline) tn::dispatch::runMainLoopOnce(milliseconds(50));
    return flag;
  }

  std::atomic<bool> busy{false};
  std::atomic<int> questions{0};
  std::atomic<bool> stopped{false};
  std::atomic<bool> exited{false};
  std::atomic<bool> exitedWhileBusy{false};
  bool clientArrivesAsItStops = false;
};

TEST_F(IdleExitWatch, BusyAtTheDeadlineGoesOnlyAfterAnEndFindsItIdle) {
  busy = true;
  const auto idleExit = start(milliseconds(1));
  ASSERT_TRUE(asked(1)) << "the watcher never looked at its deadline";
  relay::activityEnded();  // some work ended, other work goes on
  ASSERT_TRUE(asked(2)) << "an end did not wake the watcher";
  tn::dispatch::runMainLoopOnce(milliseconds(0));
  EXPECT_FALSE(stopped) << "it stopped accepting while busy";

  busy = false;
  relay::activityEnded();
  ASSERT_TRUE(happens(exited)) << "the last end never led to the exit";
  EXPECT_TRUE(stopped);
  EXPECT_FALSE(exitedWhileBusy);
}

TEST_F(IdleExitWatch, AClientAcceptedWhileItStopsIsServedToItsEnd) {
  clientArrivesAsItStops = true;
  const auto idleExit = start(milliseconds(1));
  ASSERT_TRUE(happens(stopped)) << "an idle daemon never stopped accepting";
  ASSERT_TRUE(asked(2)) << "the watcher did not look again once the listener stopped";
  tn::dispatch::runMainLoopOnce(milliseconds(0));
  EXPECT_FALSE(exited) << "it exited with a client still connected";

  busy = false;
  relay::activityEnded();  // the client hangs up
  ASSERT_TRUE(happens(exited));
  EXPECT_FALSE(exitedWhileBusy);
}

TEST_F(IdleExitWatch, GoingAwayEndsTheWatcherLongBeforeItsDeadline) {
  const auto started = std::chrono::steady_clock::now();
  start(std::chrono::hours(1)).reset();
  EXPECT_LT(std::chrono::steady_clock::now() - started, std::chrono::minutes(1));
  EXPECT_FALSE(stopped);
  relay::activityEnded();  // with no watcher left: nothing to wake, nothing breaks
}

}  // namespace
}  // namespace tnd
