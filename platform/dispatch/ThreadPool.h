// ThreadPool: the worker threads every SerialQueue runs on.
//
// The process has one shared pool (ThreadPool::shared()). It keeps about as
// many threads busy as the machine has cores (the "base" count, at least 2)
// and runs submitted tasks in FIFO order. A worker may have to block inside a
// task: SerialQueue::sync waiting for another queue, Semaphore::wait. A
// worker that blocks says so with a BlockingScope; blocked workers do not
// count as running, and when work is pending, no worker is idle and fewer
// than "base" workers are running, the pool starts an extra worker (up to a
// hard cap). So a task that a blocked worker waits for still gets a thread.
// Extra workers exit once they find no work while more than "base" workers
// are running again.
//
// Threads: tasks run on pool threads, never on the submitting thread.
// Lifetime: the shared pool object is never destroyed. When the process
// exits normally (exit() or returning from main), the pool stops taking
// tasks: its idle workers are woken and joined, so a finished process leaves
// no idle threads behind for sanitizers to wait on; workers still running a
// task are left to the end of the process (never waited for: exit cannot
// hang on a blocked worker), and tasks not yet started are abandoned.

#pragma once

#include <atomic>
#include <condition_variable>
#include <cstddef>
#include <deque>
#include <functional>
#include <list>
#include <mutex>
#include <thread>
#include <utility>

#include "platform/dispatch/QueueTarget.h"

namespace tn::dispatch {

class ThreadPool final : public QueueTarget {
 public:
  // The process-wide pool: base = max(2, hardware_concurrency),
  // cap = max(64, 4 * base). Created on first use, never destroyed.
  static ThreadPool& shared();

  // A private pool, mainly for tests. Starts no thread until work arrives.
  // Requires 1 <= baseThreads <= maxThreads.
  ThreadPool(std::size_t baseThreads, std::size_t maxThreads);

  // Runs every task still queued, then joins all workers. Must not be called
  // from one of this pool's tasks (that aborts). Hangs if a task never ends;
  // every SerialQueue targeting this pool must be idle (or gone) by then.
  ~ThreadPool() override;

  ThreadPool(const ThreadPool&) = delete;
  ThreadPool& operator=(const ThreadPool&) = delete;

  // Queues `task` to run once on a pool thread; returns at once. Any thread.
  // A task that throws is a fatal error (message on stderr, abort).
  void submit(std::function<void()> task);

  // QueueTarget: same as submit().
  void schedule(std::function<void()> task) override { submit(std::move(task)); }

  std::size_t baseThreadCount() const { return base_; }
  std::size_t maxThreadCount() const { return max_; }

  // A snapshot, for tests and diagnostics; stale as soon as it is returned.
  struct Counts {
    std::size_t threads = 0;  // worker threads alive
    std::size_t idle = 0;     // waiting for a task
    std::size_t blocked = 0;  // inside a BlockingScope
    std::size_t pending = 0;  // tasks queued, not yet started
  };
  Counts counts() const;

  // The pool whose worker the calling thread is, or nullptr.
  static ThreadPool* current();

  // Declares that the calling thread is about to block on something another
  // task may have to provide. Enter it just before waiting, leave it right
  // after. On a thread that is not a pool worker it does nothing. Nested
  // scopes on one thread count once. Must be destroyed on the thread that
  // created it.
  class BlockingScope {
   public:
    BlockingScope();
    ~BlockingScope();
    BlockingScope(const BlockingScope&) = delete;
    BlockingScope& operator=(const BlockingScope&) = delete;

   private:
    ThreadPool* pool_;  // null when this scope does nothing
  };

 private:
  struct Worker {
    std::thread thread;
    bool idle = false;  // guarded by mutex_; see workerMain
  };
  using WorkerList = std::list<Worker>;

  void workerMain(WorkerList::iterator self);
  // An idle worker's short wait for new work without sleeping (see
  // kIdleSpin). Needs mutex_ held through `lock`; releases it while
  // polling. True when a task is queued on return.
  bool spinForWork(std::unique_lock<std::mutex>& lock);
  // Starts a worker when the pending tasks outnumber the idle workers, fewer
  // than base_ workers are running and the cap allows it. Needs mutex_ held.
  void growIfNeededLocked();
  void enterBlocking();
  void leaveBlocking();
  // The shared pool's exit handler: stop, join idle workers, leave busy ones.
  void abandonAtExit();

  const std::size_t base_;
  const std::size_t max_;

  mutable std::mutex mutex_;
  std::condition_variable workAvailable_;  // workers wait here for tasks
  std::condition_variable allExited_;      // the destructor waits here
  std::deque<std::function<void()>> tasks_;
  // Live workers. A worker detaches and erases itself when it retires; once
  // stopping_ or abandoning_ is set, workers no longer touch their entries
  // and whoever set the flag owns the list.
  WorkerList workers_;
  std::size_t threads_ = 0;
  std::size_t idle_ = 0;
  std::size_t spinning_ = 0;  // idle workers polling queued_ instead of sleeping
  std::atomic<std::size_t> queued_{0};  // tasks_.size(), readable without mutex_
  std::size_t blocked_ = 0;
  bool stopping_ = false;    // destructor: run what is queued, then exit
  bool abandoning_ = false;  // process exit: start nothing more, exit
};

}  // namespace tn::dispatch
