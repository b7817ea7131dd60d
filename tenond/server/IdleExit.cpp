#include "tenond/server/IdleExit.h"

#include <condition_variable>
#include <mutex>

#include "platform/dispatch/MainLoop.h"
#include "platform/relay/KeepAlive.h"

namespace tnd {

using std::chrono::milliseconds;
using Clock = std::chrono::steady_clock;

struct IdleExit::Signals {
  std::mutex mutex;
  std::condition_variable wake;
  bool stopping = false;   // the object is going
  bool activity = false;   // something ended since the watcher last asked isIdle
  bool stopped = false;    // the listener has stopped accepting

  void raise(bool Signals::*flag) {
    {
      const std::lock_guard lock(mutex);
      this->*flag = true;
    }
    wake.notify_all();
  }
};

namespace {

// The watcher the activity handler wakes. The handler is a plain function
// (relay keeps a pointer to it), so it finds the watcher here. Never
// destroyed: a connection may end on another thread while the process
// exits.
struct CurrentWatcher {
  std::mutex mutex;
  std::weak_ptr<IdleExit::Signals> signals;
};

CurrentWatcher& currentWatcher() {
  static CurrentWatcher* const current = new CurrentWatcher;
  return *current;
}

void setCurrentWatcher(std::weak_ptr<IdleExit::Signals> signals) {
  const std::lock_guard lock(currentWatcher().mutex);
  currentWatcher().signals = std::move(signals);
}

void wakeCurrentWatcher() {
  std::shared_ptr<IdleExit::Signals> signals;
  {
    const std::lock_guard lock(currentWatcher().mutex);
    signals = currentWatcher().signals.lock();
  }
  if (signals) signals->raise(&IdleExit::Signals::activity);
}

}  // namespace

std::unique_ptr<IdleExit> IdleExit::start(milliseconds limit, Actions actions) {
  std::unique_ptr<IdleExit> idleExit(new IdleExit(limit, std::move(actions)));
  setCurrentWatcher(idleExit->signals_);
  relay::setActivityEndedHandler(wakeCurrentWatcher);
  idleExit->watcher_ = std::thread([raw = idleExit.get()] { raw->watch(); });
  return idleExit;
}

IdleExit::IdleExit(milliseconds limit, Actions actions)
    : limit_(limit), actions_(std::move(actions)), signals_(std::make_shared<Signals>()) {}

IdleExit::~IdleExit() {
  relay::setActivityEndedHandler(nullptr);
  setCurrentWatcher({});
  signals_->raise(&Signals::stopping);
  if (watcher_.joinable()) watcher_.join();
}

bool IdleExit::waitForIdleLimit() {
  std::unique_lock lock(signals_->mutex);
  // Armed from the start: a daemon that is busy then is seen so at the
  // deadline, and one that becomes idle before it signals an end.
  bool armed = true;
  Clock::time_point deadline = Clock::now() + limit_;
  for (;;) {
    const auto woken = [this] { return signals_->stopping || signals_->activity; };
    const bool signalled = armed ? signals_->wake.wait_until(lock, deadline, woken)
                                 : (signals_->wake.wait(lock, woken), true);
    if (signals_->stopping) return false;
    const bool ended = signalled && signals_->activity;
    signals_->activity = false;
    lock.unlock();  // isIdle may take the locks of what it counts
    const bool idle = actions_.isIdle();
    lock.lock();
    if (!ended && idle && !signals_->activity) return true;  // the deadline passed, idle throughout
    armed = idle;
    if (idle && ended) deadline = Clock::now() + limit_;
  }
}

bool IdleExit::waitForDrain() {
  std::unique_lock lock(signals_->mutex);
  signals_->wake.wait(lock, [this] { return signals_->stopping || signals_->stopped; });
  for (;;) {
    if (signals_->stopping) return false;
    signals_->activity = false;
    lock.unlock();
    const bool idle = actions_.isIdle();
    lock.lock();
    if (idle) return true;
    signals_->wake.wait(lock, [this] { return signals_->stopping || signals_->activity; });
  }
}

void IdleExit::watch() {
  if (!waitForIdleLimit()) return;
  // Counted only once the listener has stopped: a client it accepted before
  // is served to its end.
  tn::dispatch::mainQueue()->async([stop = actions_.stopAccepting, signals = signals_] {
    stop();
    signals->raise(&Signals::stopped);
  });
  if (!waitForDrain()) return;
  tn::dispatch::mainQueue()->async(actions_.exit);
}

}  // namespace tnd
