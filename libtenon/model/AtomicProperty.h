#pragma once

// AtomicProperty<T>: a stored field whose single reads and writes are safe
// from any thread (a read answers a copy). Compound changes (read, then
// write) are not atomic; whoever changes a record serialises its changes.
// Values (tn::Value) are cheap to copy, so reads of dictionaries cost a
// reference count.

#include <mutex>
#include <utility>

namespace tn {

template <typename T>
class AtomicProperty {
 public:
  AtomicProperty() = default;
  AtomicProperty(const AtomicProperty&) = delete;
  AtomicProperty& operator=(const AtomicProperty&) = delete;

  T get() const {
    const std::lock_guard lock(mutex_);
    return value_;
  }
  void set(T value) {
    const std::lock_guard lock(mutex_);
    value_ = std::move(value);
  }

 private:
  mutable std::mutex mutex_;
  T value_{};
};

}  // namespace tn
