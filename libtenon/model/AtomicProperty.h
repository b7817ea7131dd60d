#pragma once

// AtomicProperty<T>: a stored field whose single reads and writes are safe
// from any thread (a read answers a copy). Compound changes (read, then
// write) are not atomic; whoever changes a record serialises its changes.
// Values (tn::Value) are cheap to copy, so reads of dictionaries cost a
// reference count.
//
// The guard is a one-byte flag rather than a mutex: a record has some twenty
// properties and the daemon keeps ten thousand records, and a mutex would
// cost forty bytes each. Every critical section is one copy, so contention
// is rare and brief; a contended caller sleeps on the flag (atomic wait),
// it does not spin.

#include <atomic>
#include <utility>

namespace tn {

template <typename T>
class AtomicProperty {
 public:
  AtomicProperty() = default;
  AtomicProperty(const AtomicProperty&) = delete;
  AtomicProperty& operator=(const AtomicProperty&) = delete;

  T get() const {
    const Guard guard(busy_);
    return value_;
  }
  void set(T value) {
    const Guard guard(busy_);
    value_ = std::move(value);
  }

 private:
  class Guard {
   public:
    explicit Guard(std::atomic_flag& busy) : busy_(busy) {
      while (busy_.test_and_set(std::memory_order_acquire)) busy_.wait(true, std::memory_order_relaxed);
    }
    ~Guard() {
      busy_.clear(std::memory_order_release);
      busy_.notify_one();
    }
    Guard(const Guard&) = delete;
    Guard& operator=(const Guard&) = delete;

   private:
    std::atomic_flag& busy_;
  };

  mutable std::atomic_flag busy_;
  T value_{};
};

}  // namespace tn
