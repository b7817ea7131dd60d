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
// Idle workers and I/O (Poller.h): the shared pool may be given a Poller.
// Then one idle worker at a time waits in it instead of sleeping, and runs
// the tasks its events queued once the event is handled; only when more
// work is queued than that worker can take next are sleeping workers woken.
// At most base workers run tasks at once; when they all do, one more worker
// keeps waiting for events (and only hands their work to the others), so a
// long run of work never leaves the sockets unattended; a single task known
// to run long says so (willRunLongTask) and the waiting passes on at its
// start, as it does when the pool is given its poller while every worker
// is busy.
// A worker that submits a task from inside a task wakes nobody either while
// the task is the only one queued: it will take it itself as soon as its
// current task ends, which is what a chain of hand-offs between serial
// queues needs. Nothing in the pool spins: a worker with nothing to do
// blocks.
//
// Stalls: a pool at its cap whose workers all block while tasks wait can
// never run them. When that lasts kStallGrace without any worker getting
// free, the process ends with a fatal message naming what each worker waits
// for, instead of hanging.
//
// Threads: tasks run on pool threads, never on the submitting thread.
// Lifetime: the shared pool object is never destroyed. When the process
// exits normally (exit() or returning from main), the pool stops taking
// tasks: its idle workers are woken and joined, so a finished process leaves
// no idle threads behind for sanitizers to wait on; workers still running a
// task are left to the end of the process (never waited for: exit cannot
// hang on a blocked worker), and tasks not yet started are abandoned.

#pragma once

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <list>
#include <mutex>
#include <string>
#include <thread>
#include <utility>

#include "platform/dispatch/Poller.h"
#include "platform/dispatch/QueueTarget.h"

namespace tn::dispatch {

class ThreadPool final : public QueueTarget {
 public:
  // The process-wide pool: base = max(2, hardware_concurrency),
  // cap = max(64, 4 * base). Created on first use, never destroyed.
  static ThreadPool& shared();

  // A private pool, mainly for tests. Starts no thread until work arrives.
  // Requires 1 <= baseThreads <= maxThreads.
  ThreadPool(std::size_t baseThreads, std::size_t maxThreads, std::chrono::milliseconds stallGrace = kStallGrace);

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

  // Makes idle workers wait in `poller` (see above); starts a worker when
  // there is none, so that events are waited for from now on. Once per
  // pool; the poller must outlive the pool. Any thread.
  void setPoller(Poller* poller);

  // How long a pool may stay stalled before the process ends.
  static constexpr std::chrono::seconds kStallGrace{5};

  std::size_t baseThreadCount() const { return base_; }
  std::size_t maxThreadCount() const { return max_; }

  // A snapshot, for tests and diagnostics; stale as soon as it is returned.
  struct Counts {
    std::size_t threads = 0;  // worker threads alive
    std::size_t idle = 0;     // waiting for a task (sleeping or polling)
    std::size_t blocked = 0;  // inside a BlockingScope
    std::size_t pending = 0;  // tasks queued, not yet started
  };
  Counts counts() const;

  // The pool whose worker the calling thread is, or nullptr.
  static ThreadPool* current();

  // Called by SerialQueue before each block it runs on a pool worker. A
  // worker that left the poller to run what an event queued hands the
  // waiting for events to another worker once it has run more than
  // kBlocksBeforeHandOff blocks since: a request's own hops (its
  // connection's queue, the service queue) stay on the thread its event
  // woke, and a long run of work does not keep other events waiting.
  static void willRunBlock();
  static constexpr int kBlocksBeforeHandOff = 2;
  // Said by a task that will run long (a scan of the file system): when no
  // worker waits for events, another one does from now on, so that no
  // socket goes unattended until the task ends.
  static void willRunLongTask();

  // Declares that the calling thread is about to block on something another
  // task may have to provide. Enter it just before waiting, leave it right
  // after. On a thread that is not a pool worker it does nothing. Nested
  // scopes on one thread count once. Must be destroyed on the thread that
  // created it. `waitingFor` says what the thread waits for, for the stall
  // message ("sync onto queue 'x' from queue 'y'").
  class BlockingScope {
   public:
    explicit BlockingScope(std::string waitingFor = {});
    ~BlockingScope();
    BlockingScope(const BlockingScope&) = delete;
    BlockingScope& operator=(const BlockingScope&) = delete;

   private:
    ThreadPool* pool_;  // null when this scope does nothing
  };

 private:
  struct Worker {
    std::thread thread;
    bool idle = false;        // guarded by mutex_; see workerMain
    std::string waitingFor;   // guarded by mutex_: inside a BlockingScope
  };
  using WorkerList = std::list<Worker>;

  void workerMain(WorkerList::iterator self);
  // Runs the front task with mutex_ released. Needs mutex_ held through `lock`.
  void runFrontTask(std::unique_lock<std::mutex>& lock);
  // Waits in the poller once, with mutex_ released. Needs mutex_ held.
  void pollOnce(std::unique_lock<std::mutex>& lock);
  // Gets an idle worker to take a newly queued task: wakes a sleeper, or
  // interrupts the poller. Needs mutex_ held.
  void wakeOneLocked();
  // True while fewer than base_ workers run tasks (blocked ones aside): a
  // worker takes a task only then, so events always find a thread to wait
  // for them besides the base_ ones at work. Needs mutex_.
  bool slotFreeLocked() const;
  // Starts a worker when the pending tasks outnumber the idle workers, fewer
  // than base_ workers are running and the cap allows it. Needs mutex_ held.
  void growIfNeededLocked();
  // Gets a worker waiting in the poller when none does and one can: a
  // sleeping one, or a new one while fewer than base_ run. Needs mutex_.
  void ensurePollerLocked();
  void handOffPolling();
  bool startWorkerLocked();
  void enterBlocking(std::string waitingFor);
  void leaveBlocking();
  // Stall watch (see above). Needs mutex_ held.
  bool stalledLocked() const;
  void watchForStallLocked();
  void stallWatchMain();
  [[noreturn]] void reportStallLocked() const;
  // The shared pool's exit handler: stop, join idle workers, leave busy ones.
  void abandonAtExit();

  const std::size_t base_;
  const std::size_t max_;
  const std::chrono::milliseconds stallGrace_;

  mutable std::mutex mutex_;
  std::condition_variable workAvailable_;  // workers wait here for tasks
  std::condition_variable allExited_;      // the destructor waits here
  std::deque<std::function<void()>> tasks_;
  // Live workers. A worker detaches and erases itself when it retires; once
  // stopping_ or abandoning_ is set, workers no longer touch their entries
  // and whoever set the flag owns the list.
  WorkerList workers_;
  std::size_t threads_ = 0;
  std::size_t sleeping_ = 0;  // idle workers waiting on workAvailable_
  std::size_t blocked_ = 0;
  std::size_t runningTasks_ = 0;  // workers inside a task, blocked ones included
  Poller* poller_ = nullptr;
  bool polling_ = false;      // an idle worker waits in poller_
  uint64_t progress_ = 0;     // tasks started and blocking scopes left
  bool stopping_ = false;     // destructor: run what is queued, then exit
  bool abandoning_ = false;   // process exit: start nothing more, exit
  std::thread stallWatch_;    // started at the first stall; see kStallGrace
  std::condition_variable stallChanged_;
};

}  // namespace tn::dispatch
