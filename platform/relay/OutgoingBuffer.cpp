#include "platform/relay/OutgoingBuffer.h"

#include <algorithm>

namespace relay::detail {

void OutgoingBuffer::append(tn::Bytes frame, std::size_t alreadySent, std::shared_ptr<const void> whenSent,
                            Descriptors descriptors) {
  if (alreadySent >= frame.size()) return;
  if (alreadySent != 0) descriptors.clear();  // they left with the first byte
  size_ += frame.size() - alreadySent;
  if (frames_.empty()) frontOffset_ = alreadySent;
  else if (alreadySent != 0) frame.erase(frame.begin(), frame.begin() + static_cast<std::ptrdiff_t>(alreadySent));
  frames_.push_back(Frame{std::move(frame), std::move(whenSent), std::move(descriptors)});
}

std::size_t OutgoingBuffer::gather(std::span<iovec> out) const {
  std::size_t filled = 0;
  std::size_t offset = frontOffset_;
  for (auto it = frames_.begin(); it != frames_.end() && filled < out.size(); ++it) {
    if (filled > 0 && !it->descriptors.empty()) break;  // it leaves in a write of its own
    // iovec takes a mutable pointer; sendmsg only reads through it.
    out[filled].iov_base = const_cast<uint8_t*>(it->bytes.data() + offset);
    out[filled].iov_len = it->bytes.size() - offset;
    ++filled;
    offset = 0;
    if (!it->descriptors.empty()) break;  // nothing may follow it in the same write
  }
  return filled;
}

const Descriptors& OutgoingBuffer::descriptorsToSend() const {
  static const Descriptors kNone;
  if (frames_.empty() || frontOffset_ != 0) return kNone;
  return frames_.front().descriptors;
}

void OutgoingBuffer::consume(std::size_t count) {
  size_ -= count;
  // The kernel holds its own references to what it took with these bytes.
  if (count > 0 && !frames_.empty()) frames_.front().descriptors.clear();
  while (count > 0) {
    const std::size_t remaining = frames_.front().bytes.size() - frontOffset_;
    if (count < remaining) {
      frontOffset_ += count;
      return;
    }
    count -= remaining;
    frames_.pop_front();
    frontOffset_ = 0;
  }
}

void OutgoingBuffer::clear() {
  frames_.clear();
  frontOffset_ = 0;
  size_ = 0;
}

}  // namespace relay::detail
