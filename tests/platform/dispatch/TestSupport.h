// Waiting helpers for the dispatch tests, built on the standard library only
// so that they do not depend on the code under test. A pool task that waits
// on one of them must do so inside a ThreadPool::BlockingScope when the test
// needs the pool to keep running other work meanwhile.

#pragma once

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <functional>
#include <mutex>
#include <thread>

namespace tn::dispatch::test {

// A counter that threads can wait on to reach a value.
class Counter {
 public:
  void increment() {
    std::lock_guard lock(mutex_);
    ++value_;
    changed_.notify_all();
  }
  // Waits until the counter is at least `target`.
  void waitFor(std::size_t target) {
    std::unique_lock lock(mutex_);
    changed_.wait(lock, [&] { return value_ >= target; });
  }
  std::size_t value() const {
    std::lock_guard lock(mutex_);
    return value_;
  }

 private:
  mutable std::mutex mutex_;
  std::condition_variable changed_;
  std::size_t value_ = 0;
};

// A gate that opens once and stays open.
class Gate {
 public:
  void open() { counter_.increment(); }
  void wait() { counter_.waitFor(1); }

 private:
  Counter counter_;
};

// Polls `condition` until it holds or `limit` passes; for states that nothing
// announces (a worker retiring, a queue being freed). Returns the result.
inline bool eventually(const std::function<bool()>& condition,
                       std::chrono::seconds limit = std::chrono::seconds(20)) {
  const auto deadline = std::chrono::steady_clock::now() + limit;
  while (!condition()) {
    if (std::chrono::steady_clock::now() > deadline) {
      return false;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  return true;
}

}  // namespace tn::dispatch::test
