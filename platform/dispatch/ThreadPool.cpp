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

// The pool the calling thread works for, and how deep it is in nested
// BlockingScopes (only the outermost one counts).
thread_local ThreadPool* tlsPool = nullptr;
thread_local int tlsBlockingDepth = 0;

// How long one idle worker keeps polling for work before it sleeps. Waking
// a sleeping thread costs tens of microseconds on small virtual machines,
// which is most of a request's round trip; a worker that has just finished
// a task is likely to get the next one of the same exchange within this
// time. Only one worker polls at a time, so an idle pool costs at most
// this much processor time after each burst of work.
constexpr auto kIdleSpin = std::chrono::microseconds(100);

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

ThreadPool::ThreadPool(std::size_t baseThreads, std::size_t maxThreads)
    : base_(baseThreads), max_(maxThreads) {
  if (base_ < 1 || max_ < base_) {
    detail::fatal("ThreadPool needs 1 <= baseThreads <= maxThreads");
  }
}

ThreadPool::~ThreadPool() {
  if (tlsPool == this) {
    detail::fatal("ThreadPool destroyed from one of its own tasks");
  }
  WorkerList workers;
  {
    std::unique_lock lock(mutex_);
    stopping_ = true;
    // Workers run what is queued before they exit; make sure there is one.
    growIfNeededLocked();
    workAvailable_.notify_all();
    // Tasks may still start workers (BlockingScope) until the last one ends.
    allExited_.wait(lock, [this] { return threads_ == 0; });
    workers.swap(workers_);
  }
  for (Worker& worker : workers) {
    worker.thread.join();
  }
}

void ThreadPool::abandonAtExit() {
  std::vector<std::thread> idle;
  {
    std::lock_guard lock(mutex_);
    abandoning_ = true;
    workAvailable_.notify_all();
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

void ThreadPool::submit(std::function<void()> task) {
  std::lock_guard lock(mutex_);
  tasks_.push_back(std::move(task));
  queued_.store(tasks_.size(), std::memory_order_release);
  if (idle_ > spinning_ && tasks_.size() > spinning_) {
    workAvailable_.notify_one();  // a polling worker takes one task itself
  }
  growIfNeededLocked();
}

ThreadPool::Counts ThreadPool::counts() const {
  std::lock_guard lock(mutex_);
  return Counts{threads_, idle_, blocked_, tasks_.size()};
}

void ThreadPool::growIfNeededLocked() {
  if (abandoning_ || tasks_.size() <= idle_) {
    return;  // exiting, or every pending task has an idle worker to take it
  }
  if (threads_ - blocked_ >= base_ || threads_ >= max_) {
    return;  // enough running workers will get to it, or the cap is reached
  }
  // The new worker blocks on mutex_ (held here) before it looks at its entry,
  // so the entry is complete by then.
  const auto self = workers_.emplace(workers_.end());
  try {
    self->thread = std::thread(&ThreadPool::workerMain, this, self);
  } catch (const std::system_error& error) {
    workers_.erase(self);
    if (threads_ == 0) {
      detail::fatal(std::string("thread pool cannot start a worker: ") + error.what());
    }
    return;  // the running workers will get to the task eventually
  }
  ++threads_;
}

void ThreadPool::workerMain(WorkerList::iterator self) {
  tlsPool = this;
  std::unique_lock lock(mutex_);
  for (;;) {
    while (tasks_.empty() || abandoning_) {
      if (stopping_ || abandoning_) {
        // Whoever set the flag joins or detaches this thread; *self may be
        // gone already.
        break;
      }
      if (threads_ - blocked_ > base_) {
        // Surplus: more than base_ workers would be running once the
        // blocked ones come back.
        self->thread.detach();
        workers_.erase(self);
        break;
      }
      self->idle = true;
      ++idle_;
      if (!spinForWork(lock)) workAvailable_.wait(lock);
      --idle_;
      if (stopping_ || abandoning_) {
        break;
      }
      self->idle = false;
    }
    if (tasks_.empty() || abandoning_) {
      break;
    }
    std::function<void()> task = std::move(tasks_.front());
    tasks_.pop_front();
    queued_.store(tasks_.size(), std::memory_order_release);
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
  }
  --threads_;
  if (threads_ == 0) {
    allExited_.notify_all();
  }
  tlsPool = nullptr;
}

bool ThreadPool::spinForWork(std::unique_lock<std::mutex>& lock) {
  if (spinning_ > 0 || stopping_ || abandoning_) return !tasks_.empty();
  ++spinning_;
  lock.unlock();
  const auto deadline = std::chrono::steady_clock::now() + kIdleSpin;
  while (queued_.load(std::memory_order_acquire) == 0 && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::yield();
  }
  lock.lock();
  --spinning_;
  return !tasks_.empty() || stopping_ || abandoning_;
}

void ThreadPool::enterBlocking() {
  std::lock_guard lock(mutex_);
  ++blocked_;
  growIfNeededLocked();
}

void ThreadPool::leaveBlocking() {
  std::lock_guard lock(mutex_);
  --blocked_;
}

ThreadPool::BlockingScope::BlockingScope() : pool_(nullptr) {
  if (tlsPool == nullptr) {
    return;
  }
  if (tlsBlockingDepth++ == 0) {
    pool_ = tlsPool;
    pool_->enterBlocking();
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
