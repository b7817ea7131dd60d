#include "tenond/server/IdleExit.h"

#include <algorithm>
#include <atomic>

#include "platform/dispatch/MainLoop.h"

namespace tnd {

using std::chrono::milliseconds;
using Clock = std::chrono::steady_clock;

std::unique_ptr<IdleExit> IdleExit::start(milliseconds limit, Actions actions) {
  std::unique_ptr<IdleExit> idleExit(new IdleExit(limit, std::move(actions)));
  idleExit->watcher_ = std::thread([raw = idleExit.get()] { raw->watch(); });
  return idleExit;
}

IdleExit::IdleExit(milliseconds limit, Actions actions) : limit_(limit), actions_(std::move(actions)) {}

IdleExit::~IdleExit() {
  {
    const std::lock_guard lock(mutex_);
    stopping_ = true;
  }
  wake_.notify_all();
  if (watcher_.joinable()) watcher_.join();
}

milliseconds IdleExit::pollPeriod(milliseconds limit) {
  return std::clamp(limit / 4, milliseconds(50), milliseconds(5000));
}

bool IdleExit::pause(milliseconds period) {
  std::unique_lock lock(mutex_);
  return !wake_.wait_for(lock, period, [this] { return stopping_; });
}

void IdleExit::watch() {
  const milliseconds period = pollPeriod(limit_);
  bool wasIdle = false;
  Clock::time_point idleSince = Clock::now();
  for (;;) {
    if (!pause(period)) return;
    if (!actions_.isIdle()) {
      wasIdle = false;
      continue;
    }
    const Clock::time_point now = Clock::now();
    if (!wasIdle) idleSince = now;
    wasIdle = true;
    if (now - idleSince >= limit_) break;
  }
  // Counted only once the listener has stopped: a client it accepted before
  // is served to its end.
  auto stopped = std::make_shared<std::atomic<bool>>(false);
  tn::dispatch::mainQueue()->async([stop = actions_.stopAccepting, stopped] {
    stop();
    stopped->store(true);
  });
  const milliseconds drainPeriod = std::min(period, milliseconds(100));
  do {
    if (!pause(drainPeriod)) return;
  } while (!stopped->load() || !actions_.isIdle());
  tn::dispatch::mainQueue()->async(actions_.exit);
}

}  // namespace tnd
