// OutgoingBuffer: the frames of one socket that the kernel has not taken yet.
//
// Whole frames are appended and leave from the front, so frames never
// interleave on the wire. Frames are kept as they were encoded (no copy
// into a ring) and handed to sendmsg() as an iovec list. A frame may carry
// a token that is released once the kernel has taken its last byte (or the
// buffer is cleared): a reply's request keeps its share of the inbound
// budget until the reply has really left. A frame may carry descriptors: they
// leave with the write that takes the frame's first byte, which carries that
// frame alone (gather() never joins such a frame to the bytes before or after
// it), and the buffer closes its copies once the kernel took them. Internal to platform/relay; not
// synchronized (the channel guards it with its mutex).

#pragma once

#include <sys/uio.h>

#include <cstddef>
#include <deque>
#include <memory>
#include <span>

#include "platform/relay/Descriptors.h"
#include "platform/value/Value.h"

namespace relay::detail {

class OutgoingBuffer {
 public:
  // Queues `frame`, of which the first `alreadySent` bytes went out already;
  // `whenSent` is released once the rest has.
  void append(tn::Bytes frame, std::size_t alreadySent = 0, std::shared_ptr<const void> whenSent = nullptr,
              Descriptors descriptors = {});

  bool empty() const { return size_ == 0; }
  // Bytes still to send.
  std::size_t size() const { return size_; }

  // Describes the bytes to send next, in order, in up to out.size() iovecs.
  // Returns how many it filled. The iovecs stay valid until the next
  // append() or consume(). A frame with descriptors still to send is
  // gathered alone: when it is at the front, it is all that is filled;
  // otherwise the gathering stops before it.
  std::size_t gather(std::span<iovec> out) const;

  // The descriptors to pass with the bytes gather() describes: those of the
  // front frame when none of its bytes has left yet; empty otherwise.
  const Descriptors& descriptorsToSend() const;

  // Drops the first `count` bytes (count <= size()), as the kernel took them.
  void consume(std::size_t count);

  void clear();

 private:
  struct Frame {
    tn::Bytes bytes;
    std::shared_ptr<const void> whenSent;
    Descriptors descriptors;  // closed once the frame's first byte has left
  };
  std::deque<Frame> frames_;
  std::size_t frontOffset_ = 0;  // bytes of frames_.front() already sent
  std::size_t size_ = 0;
};

}  // namespace relay::detail
