#include "platform/dispatch/Semaphore.h"

#include "platform/dispatch/Fatal.h"
#include "platform/dispatch/ThreadPool.h"

#include "platform/dispatch/SerialQueue.h"

namespace tn::dispatch {
namespace {

std::string waitDescription() {
  const std::string held = SerialQueue::describeHeldQueues();
  return "a semaphore, holding " + (held.empty() ? std::string("nothing") : held);
}

}  // namespace

Semaphore::Semaphore(long initial) : count_(initial) {
  if (initial < 0) {
    detail::fatal("Semaphore created with a negative count");
  }
}

void Semaphore::signal() {
  std::lock_guard lock(mutex_);
  ++count_;
  positive_.notify_one();
}

void Semaphore::wait() {
  std::unique_lock lock(mutex_);
  if (count_ == 0) {
    lock.unlock();
    const ThreadPool::BlockingScope blocking(waitDescription());
    lock.lock();
    positive_.wait(lock, [this] { return count_ > 0; });
  }
  --count_;
}

bool Semaphore::waitFor(std::chrono::milliseconds timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  std::unique_lock lock(mutex_);
  if (count_ == 0) {
    lock.unlock();
    const ThreadPool::BlockingScope blocking(waitDescription());
    lock.lock();
    if (!positive_.wait_until(lock, deadline, [this] { return count_ > 0; })) {
      return false;
    }
  }
  --count_;
  return true;
}

}  // namespace tn::dispatch
