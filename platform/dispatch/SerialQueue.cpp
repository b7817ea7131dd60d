#include "platform/dispatch/SerialQueue.h"

#include <condition_variable>
#include <string>

#include "platform/dispatch/Fatal.h"
#include "platform/dispatch/ThreadPool.h"

namespace tn::dispatch {

// A sync caller waiting for its turn. Lives on the caller's stack; guarded by
// the queue's mutex_.
struct SerialQueue::Barrier {
  std::condition_variable wakeup;
  bool granted = false;
};

thread_local const SerialQueue::Held* SerialQueue::Held::top = nullptr;

SerialQueue::Held::Held(SerialQueue* q) : queue(q), outer(top) { top = this; }

SerialQueue::Held::~Held() { top = outer; }

std::shared_ptr<SerialQueue> SerialQueue::create(std::string label, int qualityOfService) {
  return create(std::move(label), qualityOfService, ThreadPool::shared());
}

std::shared_ptr<SerialQueue> SerialQueue::create(std::string label, int qualityOfService,
                                                 QueueTarget& target) {
  return std::make_shared<SerialQueue>(CreateTag{}, std::move(label), qualityOfService, target);
}

SerialQueue::SerialQueue(CreateTag, std::string label, int qualityOfService, QueueTarget& target)
    : label_(std::move(label)), qualityOfService_(qualityOfService), target_(target) {}

SerialQueue::~SerialQueue() = default;

SerialQueue* SerialQueue::current() {
  return Held::top == nullptr ? nullptr : Held::top->queue;
}

bool SerialQueue::isCurrent() const {
  for (const Held* held = Held::top; held != nullptr; held = held->outer) {
    if (held->queue == this) {
      return true;
    }
  }
  return false;
}

std::size_t SerialQueue::pendingCount() const {
  std::lock_guard lock(mutex_);
  return items_.size();
}

void SerialQueue::assertOnQueue() const {
  if (isCurrent()) {
    return;
  }
  std::string message = "assertion failed: not running on queue '" + label_ + "'";
  if (const SerialQueue* running = current()) {
    message += " (running on queue '" + running->label_ + "')";
  } else {
    message += " (not running on any queue)";
  }
  detail::fatal(message);
}

void SerialQueue::async(std::function<void()> block) {
  {
    std::lock_guard lock(mutex_);
    items_.push_back(Item{std::move(block), nullptr});
    if (owner_ != Owner::nobody) {
      return;  // the owner (drainer or sync caller) will get to it
    }
    owner_ = Owner::drainer;
  }
  scheduleDrain();
}

void SerialQueue::scheduleDrain() {
  target_.schedule([self = shared_from_this()] { self->drain(); });
}

// Runs on a target thread, owning the queue, until the queue is empty, a sync
// caller's turn comes (ownership passes to it), or the batch is used up (the
// queue goes to the back of the target's line).
void SerialQueue::drain() {
  const Held held(this);
  for (std::size_t ran = 0;; ++ran) {
    std::function<void()> block;
    {
      std::lock_guard lock(mutex_);
      if (items_.empty()) {
        owner_ = Owner::nobody;
        return;
      }
      if (handOffToBarrierLocked()) {
        return;
      }
      if (ran == kBatchLimit) {
        break;
      }
      block = std::move(items_.front().block);
      items_.pop_front();
    }
    ThreadPool::willRunBlock();
    try {
      block();
    } catch (const std::exception& error) {
      blockThrew(error.what());
    } catch (...) {
      blockThrew(nullptr);
    }
  }
  scheduleDrain();  // still owned; resume after others had a turn
}

bool SerialQueue::handOffToBarrierLocked() {
  Barrier* barrier = items_.front().barrier;
  if (barrier == nullptr) {
    return false;
  }
  items_.pop_front();
  owner_ = Owner::syncCaller;
  barrier->granted = true;
  // Notify with mutex_ held: once it is released the waiter may return and
  // destroy the barrier.
  barrier->wakeup.notify_one();
  return true;
}

bool SerialQueue::turnNeedsDrainerLocked() const {
  if (owner_ == Owner::drainer) {
    return true;
  }
  // A sync caller owns the queue; it hands it straight to the next waiting
  // sync caller, but a block in between needs a drain task.
  for (const Item& item : items_) {
    if (item.barrier == nullptr) {
      return true;
    }
  }
  return false;
}

SerialQueue& SerialQueue::SyncScope::acquired(SerialQueue& queue) {
  queue.acquireForSync();
  return queue;
}

SerialQueue::SyncScope::SyncScope(SerialQueue& queue) : queue_(acquired(queue)), held_(&queue) {}

SerialQueue::SyncScope::~SyncScope() { queue_.releaseAfterSync(); }

std::string SerialQueue::describeHeldQueues() {
  std::string text;
  for (const Held* held = Held::top; held != nullptr; held = held->outer) {
    if (!text.empty()) text += " > ";
    text += "'" + held->queue->label_ + "'";
  }
  return text;
}

bool SerialQueue::checksLockOrder() { return TN_CHECK_LOCK_ORDER != 0; }

void SerialQueue::checkLockOrder() const {
#if TN_CHECK_LOCK_ORDER
  if (lockRank_ == 0) return;
  for (const Held* held = Held::top; held != nullptr; held = held->outer) {
    const int heldRank = held->queue->lockRank_;
    if (heldRank != 0 && heldRank >= lockRank_) {
      detail::fatal("lock order: sync onto queue '" + label_ + "' (rank " + std::to_string(lockRank_) +
                    ") from a thread holding queue '" + held->queue->label_ + "' (rank " +
                    std::to_string(heldRank) + ")");
    }
  }
#endif
}

void SerialQueue::acquireForSync() {
  if (isCurrent()) {
    detail::fatal("sync onto queue '" + label_ + "' from a block running on it would deadlock");
  }
  checkLockOrder();
  std::unique_lock lock(mutex_);
  if (owner_ == Owner::nobody) {
    owner_ = Owner::syncCaller;  // idle and empty: take it here ("inline sync")
    return;
  }
  if (target_.waitingWouldStall() && turnNeedsDrainerLocked()) {
    detail::fatal("sync onto queue '" + label_ +
                  "' from the thread that runs it, outside its loop, would deadlock");
  }
  Barrier barrier;
  items_.push_back(Item{{}, &barrier});
  lock.unlock();
  // Entered without mutex_ held: the pool may start a thread here.
  const ThreadPool::BlockingScope blocking("sync onto queue '" + label_ + "' holding " +
                                           (Held::top ? describeHeldQueues() : std::string("nothing")));
  lock.lock();
  barrier.wakeup.wait(lock, [&barrier] { return barrier.granted; });
}

void SerialQueue::releaseAfterSync() {
  {
    std::lock_guard lock(mutex_);
    if (items_.empty()) {
      owner_ = Owner::nobody;
      return;
    }
    if (handOffToBarrierLocked()) {
      return;  // straight to the next sync caller
    }
    owner_ = Owner::drainer;
  }
  scheduleDrain();
}

void SerialQueue::blockThrew(const char* what) const {
  detail::fatalBlockThrew("on queue '" + label_ + "'", what);
}

}  // namespace tn::dispatch
