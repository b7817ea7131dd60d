// Semaphore: a counting semaphore.
//
// signal() adds one to the count and wakes one waiter; wait() takes one,
// blocking while the count is zero. Waiters are not ordered. A pool worker
// that has to block here enters a ThreadPool::BlockingScope, so the signal it
// waits for can still be produced by another pool task.
//
// Threads: any. Lifetime: must outlive every wait() and signal() call on it;
// destroying it while a thread waits is undefined.

#pragma once

#include <chrono>
#include <condition_variable>
#include <mutex>

namespace tn::dispatch {

class Semaphore {
 public:
  // `initial` must be >= 0 (a negative count aborts).
  explicit Semaphore(long initial = 0);
  Semaphore(const Semaphore&) = delete;
  Semaphore& operator=(const Semaphore&) = delete;

  // Increments the count; wakes one waiter if there is one.
  void signal();

  // Decrements the count, waiting as long as it takes for it to be positive.
  void wait();

  // Like wait(), but gives up after `timeout`: true when the count was
  // decremented, false when the time ran out (the count is unchanged).
  bool waitFor(std::chrono::milliseconds timeout);

 private:
  std::mutex mutex_;
  std::condition_variable positive_;
  long count_;  // guarded by mutex_
};

}  // namespace tn::dispatch
