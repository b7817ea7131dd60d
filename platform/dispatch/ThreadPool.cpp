#include "platform/dispatch/ThreadPool.h"

#include <algorithm>
#include <cstdlib>
#include <exception>
#include <string>
#include <system_error>
#include <utility>
#include <vector>

#include "platform/dispatch/Fatal.h"

namespace tn::dispatch {

namespace {

// The pool the calling thread works for, its entry in the pool's worker
// list, and how deep it is in nested BlockingScopes (only the outermost one
// counts).
thread_local ThreadPool* tlsPool = nullptr;
thread_local void* tlsWorker = nullptr;
thread_local int tlsBlockingDepth = 0;
// Blocks this worker ran since it left the poller; -1 when it is not in
// such a run (it did not come from the poller, or handed the role on).
thread_local int tlsBlocksSincePoll = -1;

}  // namespace

ThreadPool& ThreadPool::shared() {
  // The object is deliberately leaked: workers that are busy when the
  // process exits keep using it until the process is gone.
  static ThreadPool* const pool = [] {
    const std::size_t base = std::max<std::size_t>(2, std::thread::hardware_concurrency());
    auto* created = new ThreadPool(base, std::max<std::size_t>(64, 4 * base));
    std::atexit([] { ThreadPool::shared().abandonAtExit(); });
    return created;
  }();
  return *pool;
}

ThreadPool::ThreadPool(std::size_t baseThreads, std::size_t maxThreads, std::chrono::milliseconds stallGrace)
    : base_(baseThreads), max_(maxThreads), stallGrace_(stallGrace) {
  if (base_ < 1 || max_ < base_) {
    detail::fatal("ThreadPool needs 1 <= baseThreads <= maxThreads");
  }
}

ThreadPool::~ThreadPool() {
  if (tlsPool == this) {
    detail::fatal("ThreadPool destroyed from one of its own tasks");
  }
  WorkerList workers;
  std::thread stallWatch;
  {
    std::unique_lock lock(mutex_);
    stopping_ = true;
    // Workers run what is queued before they exit; make sure there is one.
    growIfNeededLocked();
    workAvailable_.notify_all();
    if (polling_) poller_->interrupt();
    stallChanged_.notify_all();
    // Tasks may still start workers (BlockingScope) until the last one ends.
    allExited_.wait(lock, [this] { return threads_ == 0; });
    workers.swap(workers_);
    stallWatch.swap(stallWatch_);
  }
  for (Worker& worker : workers) {
    worker.thread.join();
  }
  if (stallWatch.joinable()) stallWatch.join();
}

void ThreadPool::abandonAtExit() {
  std::vector<std::thread> idle;
  {
    std::lock_guard lock(mutex_);
    abandoning_ = true;
    workAvailable_.notify_all();
    if (polling_) poller_->interrupt();
    stallChanged_.notify_all();
    if (stallWatch_.joinable()) stallWatch_.detach();
    for (Worker& worker : workers_) {
      if (worker.idle) {
        idle.push_back(std::move(worker.thread));
      } else {
        worker.thread.detach();  // busy: may never return; not waited for
      }
    }
    workers_.clear();
  }
  for (std::thread& thread : idle) {
    thread.join();  // woken above; returns at once
  }
}

ThreadPool* ThreadPool::current() { return tlsPool; }

void ThreadPool::setPoller(Poller* poller) {
  std::lock_guard lock(mutex_);
  if (poller_ != nullptr) detail::fatal("ThreadPool::setPoller called twice");
  poller_ = poller;
  if (abandoning_ || stopping_) return;
  // A sleeping worker becomes the poller; with none (every worker busy with
  // a task that may run long, such as a scan begun before the first socket
  // was made), one more is started for it.
  ensurePollerLocked();
  if (threads_ == 0) detail::fatal("thread pool cannot start a worker to wait for events");
}

void ThreadPool::submit(std::function<void()> task) {
  std::lock_guard lock(mutex_);
  tasks_.push_back(std::move(task));
  // A worker submitting the only queued task takes it itself as soon as its
  // current task (or event) is done: waking another thread for it would
  // only move the work, at the price of a wake-up.
  const bool submitterTakesIt = tlsPool == this && tasks_.size() == 1;
  if (!submitterTakesIt) wakeOneLocked();
  growIfNeededLocked();
}

bool ThreadPool::slotFreeLocked() const { return runningTasks_ - blocked_ < base_; }

void ThreadPool::wakeOneLocked() {
  if (!slotFreeLocked()) return;  // the running workers take it as each finishes
  if (sleeping_ > 0) {
    workAvailable_.notify_one();
  } else if (polling_) {
    poller_->interrupt();
  }
}

ThreadPool::Counts ThreadPool::counts() const {
  std::lock_guard lock(mutex_);
  return Counts{threads_, sleeping_ + (polling_ ? 1u : 0u), blocked_, tasks_.size()};
}

void ThreadPool::ensurePollerLocked() {
  if (poller_ == nullptr || polling_ || stopping_ || abandoning_) return;
  if (sleeping_ > 0) {
    workAvailable_.notify_one();  // with the task slots taken, it becomes the poller
  } else if (threads_ - blocked_ < base_ + 1 && threads_ < max_) {
    startWorkerLocked();  // one worker beyond base_ may wait for events
  }
}

void ThreadPool::growIfNeededLocked() {
  const std::size_t idle = sleeping_ + (polling_ ? 1 : 0);
  if (abandoning_ || tasks_.size() <= idle) {
    return;  // exiting, or every pending task has an idle worker to take it
  }
  if (threads_ - blocked_ >= base_ || threads_ >= max_) {
    watchForStallLocked();
    return;  // enough running workers will get to it, or the cap is reached
  }
  if (!startWorkerLocked() && threads_ == 0) {
    detail::fatal("thread pool cannot start a worker");
  }
}

bool ThreadPool::startWorkerLocked() {
  // The new worker blocks on mutex_ (held here) before it looks at its entry,
  // so the entry is complete by then.
  const auto self = workers_.emplace(workers_.end());
  try {
    self->thread = std::thread(&ThreadPool::workerMain, this, self);
  } catch (const std::system_error&) {
    workers_.erase(self);
    return false;  // the running workers will get to the task eventually
  }
  ++threads_;
  return true;
}

void ThreadPool::workerMain(WorkerList::iterator self) {
  tlsPool = this;
  tlsWorker = &*self;
  std::unique_lock lock(mutex_);
  for (;;) {
    if (abandoning_ || (stopping_ && tasks_.empty())) {
      break;  // whoever set the flag joins or detaches this thread
    }
    if (!tasks_.empty() && (slotFreeLocked() || stopping_)) {
      self->idle = false;
      runFrontTask(lock);
      continue;
    }
    if (threads_ - blocked_ > base_ + (poller_ != nullptr ? 1 : 0)) {
      // Surplus: more than base_ workers (and the one waiting for events)
      // would be running once the blocked ones come back.
      self->thread.detach();
      workers_.erase(self);
      break;
    }
    self->idle = true;
    if (poller_ != nullptr && !polling_ && !stopping_) {
      pollOnce(lock);
      continue;
    }
    ++sleeping_;
    workAvailable_.wait(lock);
    --sleeping_;
  }
  --threads_;
  if (threads_ == 0) {
    allExited_.notify_all();
  }
  tlsPool = nullptr;
  tlsWorker = nullptr;
}

void ThreadPool::runFrontTask(std::unique_lock<std::mutex>& lock) {
  std::function<void()> task = std::move(tasks_.front());
  tasks_.pop_front();
  ++progress_;
  ++runningTasks_;
  lock.unlock();
  try {
    task();
  } catch (const std::exception& error) {
    detail::fatalBlockThrew("on the thread pool", error.what());
  } catch (...) {
    detail::fatalBlockThrew("on the thread pool", nullptr);
  }
  task = nullptr;  // release the task's captures outside the lock
  lock.lock();
  --runningTasks_;
}

void ThreadPool::willRunBlock() {
  if (tlsPool == nullptr || tlsBlocksSincePoll < 0) return;
  if (++tlsBlocksSincePoll <= kBlocksBeforeHandOff) return;
  tlsBlocksSincePoll = -1;
  tlsPool->handOffPolling();
}

void ThreadPool::willRunLongTask() {
  if (tlsPool == nullptr) return;
  // Whether or not this worker came from the poller: the worker woken to
  // become the poller may have taken a task instead.
  tlsBlocksSincePoll = -1;
  tlsPool->handOffPolling();
}

void ThreadPool::handOffPolling() {
  std::lock_guard lock(mutex_);
  ensurePollerLocked();
}

void ThreadPool::pollOnce(std::unique_lock<std::mutex>& lock) {
  polling_ = true;
  tlsBlocksSincePoll = -1;
  lock.unlock();
  poller_->pollOnce();
  lock.lock();
  polling_ = false;
  tlsBlocksSincePoll = 0;
  // This worker now runs what the event queued. Events keep coming while it
  // does: when more is queued than it takes next, or the work it takes may
  // be long, a sleeping worker takes over the waiting.
  if (tasks_.size() > 1 && sleeping_ > 0) workAvailable_.notify_one();
}

void ThreadPool::enterBlocking(std::string waitingFor) {
  std::lock_guard lock(mutex_);
  ++blocked_;
  // After abandonAtExit() the entries are gone.
  if (!abandoning_) static_cast<Worker*>(tlsWorker)->waitingFor = std::move(waitingFor);
  // Queued tasks an idle worker could take now are its to take, and events
  // must not wait until this worker is free again.
  if (!tasks_.empty()) wakeOneLocked();
  ensurePollerLocked();
  growIfNeededLocked();
}

void ThreadPool::leaveBlocking() {
  std::lock_guard lock(mutex_);
  --blocked_;
  ++progress_;
  if (!abandoning_) static_cast<Worker*>(tlsWorker)->waitingFor.clear();
}

bool ThreadPool::stalledLocked() const {
  return !abandoning_ && !stopping_ && !tasks_.empty() && threads_ >= max_ && blocked_ == threads_;
}

void ThreadPool::watchForStallLocked() {
  if (!stalledLocked()) return;
  if (!stallWatch_.joinable()) {
    try {
      stallWatch_ = std::thread(&ThreadPool::stallWatchMain, this);
    } catch (const std::system_error&) {
      return;  // no thread to watch with; the stall would only hang
    }
  }
  stallChanged_.notify_all();
}

void ThreadPool::stallWatchMain() {
  std::unique_lock lock(mutex_);
  while (!abandoning_ && !stopping_) {
    if (!stalledLocked()) {
      stallChanged_.wait(lock);
      continue;
    }
    const uint64_t seen = progress_;
    stallChanged_.wait_for(lock, stallGrace_, [&] { return progress_ != seen || !stalledLocked(); });
    if (stalledLocked() && progress_ == seen) reportStallLocked();
  }
}

void ThreadPool::reportStallLocked() const {
  std::string message = "thread pool stalled: all " + std::to_string(threads_) +
                        " workers (its cap) are blocked while " + std::to_string(tasks_.size()) +
                        " tasks wait; the workers wait for:";
  for (const Worker& worker : workers_) {
    message += " [" + (worker.waitingFor.empty() ? std::string("?") : worker.waitingFor) + "]";
  }
  detail::fatal(message);
}

ThreadPool::BlockingScope::BlockingScope(std::string waitingFor) : pool_(nullptr) {
  if (tlsPool == nullptr) {
    return;
  }
  if (tlsBlockingDepth++ == 0) {
    pool_ = tlsPool;
    pool_->enterBlocking(std::move(waitingFor));
  }
}

ThreadPool::BlockingScope::~BlockingScope() {
  if (tlsPool == nullptr) {
    return;
  }
  --tlsBlockingDepth;
  if (pool_ != nullptr) {
    pool_->leaveBlocking();
  }
}

}  // namespace tn::dispatch
