#pragma once

// Observer: runs a handler on a queue once for every post of a notification
// made after the observer was created, by this process or any other.
//
//   auto observer = notify::Observer::create("com.ostrel.tenon.changed", queue,
//                                            [] { reload(); });
//
// Each observer has its own DirectoryWatch of the notification directory,
// whose thread queues the handler calls; the handler itself runs on the queue.
// Posts are never coalesced: when the count grew by three since the observer
// last looked, three calls are queued. A count that goes down (the file was
// removed and posted again) starts over from zero. At most kMaxBurst calls
// are queued for one change, so a file rewritten with a huge number cannot
// flood the queue. Removing the notification directory ends observation
// (logged at error level on "ops").

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>

#include "platform/dispatch/SerialQueue.h"
#include "platform/notify/DirectoryWatch.h"
#include "platform/value/Result.h"

namespace notify {

class Observer {
  struct CreateTag {
    explicit CreateTag() = default;
  };

 public:
  static constexpr uint64_t kMaxBurst = 4096;

  // Starts observing name: creates the notification directory (0755) if
  // needed, records the current count, and from then on queues handler on
  // queue once per post. Errors: InvalidName, InvalidArgument (no queue or
  // no handler), FileSystem (directory or inotify).
  static tn::Result<std::unique_ptr<Observer>> create(std::string_view name,
                                                      std::shared_ptr<tn::dispatch::SerialQueue> queue,
                                                      std::function<void()> handler);

  // Stops observing. No handler call starts after the destructor returns: it
  // waits (with a sync onto the queue) for calls already queued, which then
  // skip the handler. Destroy the observer on its queue (for example from
  // the handler) or on a thread that may wait for the queue.
  ~Observer();
  Observer(const Observer&) = delete;
  Observer& operator=(const Observer&) = delete;

  const std::string& name() const { return name_; }

  // What the watch thread and the queued blocks share with the observer.
  struct Delivery;

  Observer(CreateTag, std::string name, std::shared_ptr<tn::dispatch::SerialQueue> queue,
           std::shared_ptr<Delivery> delivery, std::unique_ptr<DirectoryWatch> watch);

 private:
  const std::string name_;
  const std::shared_ptr<tn::dispatch::SerialQueue> queue_;
  const std::shared_ptr<Delivery> delivery_;
  std::unique_ptr<DirectoryWatch> watch_;
};

}  // namespace notify
