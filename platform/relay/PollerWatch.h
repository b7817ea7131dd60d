// PollerWatch: waiting for a descriptor or a time on the process's I/O
// poller (IoContext.h) instead of a thread of one's own.
//
//   auto watch = relay::PollerWatch::whenReadable(pidfd, queue, [] { ... });
//   auto timer = relay::PollerWatch::after(std::chrono::seconds(2), queue, [] { ... });
//
// The block runs once, on `queue`, when the descriptor becomes readable (a
// pidfd does when its process exits) or the time has passed, unless the
// watch was cancelled or destroyed first; a cancelled watch's block never
// starts. The watch keeps a duplicate of the descriptor, so the caller may
// close its own at any time. Nothing waits on a queue or a lock: the
// poller's idle worker notices the event and posts the block.
//
// Threads: any; cancel() may race with the event, and then exactly one of
// the two wins.

#pragma once

#include <atomic>
#include <chrono>
#include <functional>
#include <memory>

#include "platform/dispatch/SerialQueue.h"

namespace relay {

class PollerWatch : public std::enable_shared_from_this<PollerWatch> {
 public:
  using Block = std::function<void()>;

  // Watches `fd` for readability. Null when the descriptor cannot be
  // duplicated (the process is out of descriptors).
  static std::shared_ptr<PollerWatch> whenReadable(int fd, std::shared_ptr<tn::dispatch::SerialQueue> queue,
                                                   Block block);

  // Runs `block` once `delay` has passed.
  static std::shared_ptr<PollerWatch> after(std::chrono::milliseconds delay,
                                            std::shared_ptr<tn::dispatch::SerialQueue> queue, Block block);

  ~PollerWatch();
  PollerWatch(const PollerWatch&) = delete;
  PollerWatch& operator=(const PollerWatch&) = delete;

  // Stops the watch; the block will not start after this returns (it may
  // be running already on its queue).
  void cancel();

  struct State;  // shared with the I/O handler; in PollerWatch.cpp

 private:
  explicit PollerWatch(std::shared_ptr<State> state) : state_(std::move(state)) {}
  std::shared_ptr<State> state_;
};

}  // namespace relay
