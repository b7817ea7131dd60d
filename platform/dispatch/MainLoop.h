// MainLoop: the main thread's event loop, and the main queue it serves.
//
// mainQueue() is a SerialQueue like any other except for where its blocks
// run: on the process's main thread (the thread whose id is the process id),
// inside runMainLoop() (or runMainLoopUntil / runMainLoopOnce). The daemon's
// main thread starts up, then calls runMainLoop() and never returns; blocks on
// the main queue (the SIGTERM handler, for one) end the process with exit().
//
// Contracts:
// - The loop functions must be called on the main thread, and not from inside
//   the loop (no nesting); otherwise the process aborts.
// - Any thread may async() onto the main queue. A thread other than the main
//   thread may sync() onto it: the caller waits its turn (the main thread must
//   be running the loop) and then runs the block itself, as with any queue.
// - The main thread, outside the loop, may sync() onto the main queue when
//   its turn can come without the loop: the queue is idle (the block runs at
//   once), or another thread holds it in a sync with no blocks queued ahead
//   (the queue is handed over). If a block is queued or running ahead,
//   waiting could never end (only this thread runs blocks), so the process
//   aborts. From a block on the main queue, sync onto it aborts like any
//   self-sync.
// - Blocks queued when the process exits never run.

#pragma once

#include <chrono>
#include <condition_variable>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>

#include "platform/dispatch/QueueTarget.h"
#include "platform/dispatch/SerialQueue.h"

namespace tn::dispatch {

class MainLoop final : public QueueTarget {
 public:
  // The process's loop. Created on first use, never destroyed.
  static MainLoop& shared();

  // True on the process's main thread.
  static bool isMainThread();

  MainLoop(const MainLoop&) = delete;
  MainLoop& operator=(const MainLoop&) = delete;

  // QueueTarget: `task` runs on the main thread, inside the loop. Any thread.
  void schedule(std::function<void()> task) override;

  // QueueTarget: true on the main thread, which alone runs the loop.
  bool waitingWouldStall() const override { return isMainThread(); }

  // Runs scheduled tasks in order, forever. Main thread only.
  [[noreturn]] void run();

  // Runs scheduled tasks until `done()` is true. `done` is evaluated on the
  // main thread before the first wait and after every task, and only then:
  // a condition that another thread makes true must be followed by some work
  // for the loop (e.g. mainQueue()->async([] {})) or the loop sleeps on.
  // Main thread only.
  void runUntil(const std::function<bool()>& done);

  // Runs at most one scheduled task, waiting up to `timeout` for one. Returns
  // whether a task ran. Main thread only.
  bool runOnce(std::chrono::milliseconds timeout);

 private:
  MainLoop() = default;

  class Running;  // checks and marks that the main thread is in the loop
  // Waits for the next task (until `deadline`, if given) and runs it.
  bool runNext(const std::chrono::steady_clock::time_point* deadline);

  std::mutex mutex_;
  std::condition_variable taskAvailable_;
  std::deque<std::function<void()>> tasks_;  // guarded by mutex_
  bool running_ = false;                     // main thread only
};

// The main queue: label "main", blocks run by the main thread in the loop.
const std::shared_ptr<SerialQueue>& mainQueue();

// MainLoop::shared().run() / runUntil() / runOnce().
[[noreturn]] void runMainLoop();
void runMainLoopUntil(const std::function<bool()>& done);
bool runMainLoopOnce(std::chrono::milliseconds timeout);

}  // namespace tn::dispatch
