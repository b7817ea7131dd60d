// InboundBudget: how much one connection has delivered that its owner has
// not handled yet, and the back-pressure that follows from it.
//
// Every frame read is charged (one message and its length) when it is
// posted to a queue, and released once its handler has run. While the
// charges reach either limit, the I/O thread stops reading that socket: the
// peer's further frames wait in the kernel and then in the peer itself, and
// nothing else is slowed down. Reading resumes when the owner has caught up
// to half of both limits. The limits are soft by at most one read's worth
// of frames (64 KiB: the frames already read are always delivered).
//
// Threads: charge() and pause() on the I/O thread; release() on any thread.

#pragma once

#include <atomic>
#include <cstddef>

#include "platform/relay/Descriptors.h"

namespace relay::detail {

struct InboundLimits {
  std::size_t messages = 1024;
  std::size_t bytes = 32u * 1024u * 1024u;
  // Descriptors one inbound frame may bring (Descriptors.h); more ends the
  // connection.
  std::size_t descriptorsPerFrame = kMaxDescriptorsPerFrame;
};

class InboundBudget {
 public:
  explicit InboundBudget(InboundLimits limits = {}) : limits_(limits) {}

  void charge(std::size_t bytes);

  // Releases a handled frame. True when this brought the budget back under
  // the resume mark while reading was paused: the caller must then get
  // reading going again (exactly one caller is told so).
  bool release(std::size_t bytes);

  // True when either limit is reached.
  bool exhausted() const;

  // Marks reading as paused. Returns false when the owner caught up
  // meanwhile and the I/O thread should simply keep reading.
  bool pause();

  std::size_t pendingMessages() const { return messages_.load(); }
  std::size_t pendingBytes() const { return bytes_.load(); }

 private:
  bool belowResumeMark() const;

  const InboundLimits limits_;
  std::atomic<std::size_t> messages_{0};
  std::atomic<std::size_t> bytes_{0};
  std::atomic<bool> paused_{false};
};

}  // namespace relay::detail
