// SerialQueue: the one concurrency primitive of Tenon.
//
// A queue runs the blocks given to it one at a time, in the order they were
// given, on threads of its target (the shared ThreadPool unless stated
// otherwise). It owns no thread, so queues are cheap: one per connection, or
// ten thousand at once, is fine.
//
//   auto queue = SerialQueue::create("TNDatabase");
//   queue->async([] { ... });                 // enqueue, return at once
//   int n = queue->sync([&] { return ...; }); // run here, in queue order
//
// Contracts:
// - async(block): block runs later on a target thread, after every block
//   given before it and before every block given after it. The queue keeps
//   itself alive while it has work, so dropping the last reference after
//   async() is fine: the pending blocks still run.
// - sync(block): block runs ON THE CALLING THREAD, once everything queued
//   before it has run, while nothing else of the queue runs; then the queue
//   continues with what was queued after it. Its result is sync's result.
//   While a sync block runs, the calling thread holds the queue: no pool
//   thread is kept waiting for it. The caller must keep a reference to the
//   queue for the duration of the call.
// - sync onto a queue the calling thread already holds (it is running one of
//   its blocks, directly or further out through nested syncs) would wait on
//   itself: the process aborts with "tenon: fatal: sync onto queue '<label>'
//   from a block running on it would deadlock". Nested sync onto other
//   queues is fine, but the program must respect a lock order between queues
//   (Tenon's: "service" may sync onto "serverSync" or "TNDatabase"; those two
//   sync onto nothing); a cycle between threads deadlocks and is not detected.
// - Blocks must not throw. An exception leaving a block aborts the process
//   with a message naming the queue.
// - assertOnQueue() aborts unless the calling thread holds this queue (as
//   above: running one of its blocks, or inside a sync onto it, however deep
//   in nested syncs). isCurrent() answers the same question.
// - Lock order: a queue may be given a rank (setLockRank). In builds that
//   check it (debug and sanitizer builds: TN_CHECK_LOCK_ORDER), a sync onto
//   a ranked queue from a thread that holds a ranked queue of the same or a
//   higher rank aborts with "tenon: fatal: lock order: ..." naming both, so
//   that an order that could deadlock between threads fails on first use,
//   not in the rare interleaving that hangs. Unranked queues are not checked.
// - Fairness: a queue with a long backlog gives its thread back to the pool
//   after a batch of kBatchLimit blocks and queues itself again behind the
//   other work, so one busy queue cannot starve the others.

#pragma once

#include <cstddef>
#include <deque>
#include <exception>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <type_traits>
#include <utility>

#include "platform/dispatch/QueueTarget.h"

namespace tn::dispatch {

class SerialQueue : public std::enable_shared_from_this<SerialQueue> {
  struct CreateTag {
    explicit CreateTag() = default;
  };

 public:
  // Blocks run per turn on a pool thread before the queue yields it.
  static constexpr std::size_t kBatchLimit = 16;

  // A queue on the shared ThreadPool. `qualityOfService` is informational
  // (kept as a property; the daemon uses 25 for user-initiated work).
  static std::shared_ptr<SerialQueue> create(std::string label, int qualityOfService = 0);

  // A queue on `target`, which must outlive every block of the queue.
  static std::shared_ptr<SerialQueue> create(std::string label, int qualityOfService,
                                             QueueTarget& target);

  SerialQueue(CreateTag, std::string label, int qualityOfService, QueueTarget& target);
  ~SerialQueue();
  SerialQueue(const SerialQueue&) = delete;
  SerialQueue& operator=(const SerialQueue&) = delete;

  const std::string& label() const { return label_; }
  int qualityOfService() const { return qualityOfService_; }

  // The queue's place in the lock order (see above); 0, the default, means
  // unranked. Set it before the queue is used.
  void setLockRank(int rank) { lockRank_ = rank; }
  int lockRank() const { return lockRank_; }

  // True in builds that check the lock order.
  static bool checksLockOrder();

  // "'a' (held) > 'b' (held)": the queues the calling thread holds,
  // innermost first; empty when it holds none. For diagnostics.
  static std::string describeHeldQueues();

  // Enqueues `block` and returns. Any thread, also from a block of this
  // queue.
  void async(std::function<void()> block);

  // Runs `block` on the calling thread in queue order and returns its result
  // (void allowed). Any thread except one already holding this queue (that
  // aborts). When the caller is a pool worker it counts as blocked while it
  // waits for its turn.
  template <typename Block>
  std::invoke_result_t<Block&> sync(Block&& block) {
    const SyncScope scope(*this);
    try {
      return std::invoke(block);
    } catch (const std::exception& error) {
      blockThrew(error.what());
    } catch (...) {
      blockThrew(nullptr);
    }
  }

  // Aborts with a message naming this queue unless the calling thread holds
  // it. Any thread.
  void assertOnQueue() const;

  // True when the calling thread holds this queue. Any thread.
  bool isCurrent() const;

  // Blocks and sync callers queued and not yet started. A snapshot for
  // tests and diagnostics. Any thread.
  std::size_t pendingCount() const;

  // The queue whose block the calling thread runs innermost (the target of
  // the innermost sync, or the queue of the running async block), or nullptr.
  static SerialQueue* current();

 private:
  // One entry of the thread-local stack of queues the thread holds. Lives on
  // the thread's stack while the thread holds `queue`.
  struct Held {
    explicit Held(SerialQueue* queue);
    ~Held();
    Held(const Held&) = delete;
    Held& operator=(const Held&) = delete;

    SerialQueue* const queue;
    const Held* const outer;

    static thread_local const Held* top;  // innermost, or nullptr
  };

  // Takes the queue for the calling thread for a sync block (at once when it
  // is idle, else after the queued work before it) and gives it back.
  class SyncScope {
   public:
    explicit SyncScope(SerialQueue& queue);
    ~SyncScope();
    SyncScope(const SyncScope&) = delete;
    SyncScope& operator=(const SyncScope&) = delete;

   private:
    static SerialQueue& acquired(SerialQueue& queue);

    SerialQueue& queue_;
    Held held_;  // pushed once the queue is ours, popped after it is given back
  };

  struct Barrier;
  struct Item {
    std::function<void()> block;  // empty for a barrier
    Barrier* barrier = nullptr;   // a sync caller waiting for its turn
  };

  void acquireForSync();
  // Aborts when a sync onto this queue from the calling thread breaks the
  // lock order (in builds that check it).
  void checkLockOrder() const;
  void releaseAfterSync();
  // Grants the queue to the barrier at the front, if there is one. Needs
  // mutex_ held and the queue owned by the calling thread.
  bool handOffToBarrierLocked();
  // Whether a sync caller queued now would only get its turn through a drain
  // task of the target (and not by hand-offs between sync callers alone).
  bool turnNeedsDrainerLocked() const;
  void scheduleDrain();
  void drain();
  [[noreturn]] void blockThrew(const char* what) const;

  const std::string label_;
  const int qualityOfService_;
  int lockRank_ = 0;
  QueueTarget& target_;

  mutable std::mutex mutex_;
  std::deque<Item> items_;  // guarded by mutex_
  // Who owns the queue: nobody, a drain task (scheduled or running on the
  // target), or a sync caller running its block. Guarded by mutex_.
  // Invariant: when nobody owns it, items_ is empty.
  enum class Owner { nobody, drainer, syncCaller };
  Owner owner_ = Owner::nobody;
};

}  // namespace tn::dispatch
