#include "platform/relay/Channel.h"

#include <sys/socket.h>
#include <string.h>

#include <cstring>

#include <algorithm>
#include <array>
#include <asio/post.hpp>
#include <cerrno>
#include <utility>
#include <vector>

#include <fmt/format.h>

#include "platform/relay/IoContext.h"
#include "platform/relay/RelayError.h"

namespace relay::detail {
namespace {

// One read takes at most this much; a socket gets at most kReadsPerTurn
// reads before the I/O thread turns to the others.
constexpr std::size_t kReadChunk = 64 * 1024;
constexpr int kReadsPerTurn = 4;
// iovecs per sendmsg.
constexpr std::size_t kGatherLimit = 16;

std::string describeErrno(std::string_view what, int errnoValue) {
  const char* text = strerrordesc_np(errnoValue);
  return fmt::format("{}: {}", what, text != nullptr ? text : "unknown error");
}

bool wouldBlock(int errnoValue) { return errnoValue == EAGAIN || errnoValue == EWOULDBLOCK; }

}  // namespace

std::shared_ptr<Channel> Channel::create(UniqueFd socket, Callbacks callbacks, std::shared_ptr<void> lease,
                                         InboundLimits limits) {
  return std::shared_ptr<Channel>(
      new Channel(std::move(socket), std::move(callbacks), std::move(lease), limits));
}

Channel::Channel(UniqueFd socket, Callbacks callbacks, std::shared_ptr<void> lease, InboundLimits limits)
    : fd_(socket.get()),
      socket_(ioContext(), socket.release()),
      callbacks_(std::move(callbacks)),
      budget_(limits),
      lease_(std::move(lease)) {
  reader_.setMaxDescriptorsPerFrame(std::min(limits.descriptorsPerFrame, kMaxDescriptorsPerFrame));
}

Channel::~Channel() {
  // Normally the I/O thread closed the channel and failed its requests. A
  // channel dropped without a close still owes its handlers an answer.
  for (PendingReply& pending : pending_.takeAll()) {
    pending.queue->async([handler = std::move(pending.handler)] {
      handler(makeRelayError(RelayErrorCode::ConnectionInvalid, "the connection was released"), {});
    });
  }
}

void Channel::start() {
  asio::post(ioContext(), [self = shared_from_this()] {
    if (self->started_) return;
    self->started_ = true;
    self->armRead();
  });
}

bool Channel::send(tn::Bytes frame, PendingReply* pending, std::shared_ptr<const void> whenSent,
                   Descriptors descriptors) {
  const std::lock_guard lock(mutex_);
  if (closing_ || closed_) return false;
  setFrameId(frame, ++lastSentId_);
  if (pending != nullptr) pending_.add(lastSentId_, std::move(*pending));
  outgoing_.append(std::move(frame), 0, std::move(whenSent), std::move(descriptors));
  if (writeArmed_) {
    // The I/O thread is waiting to write what is queued ahead; keep order.
    if (outgoing_.size() > kMaxOutgoingBytes) {
      requestCloseLocked(CloseCause::OutgoingOverflow,
                         fmt::format("the peer left more than {} bytes unread", kMaxOutgoingBytes));
    }
    return true;
  }
  if (const int error = writeQueuedLocked(); error != 0) {
    requestCloseLocked(CloseCause::PeerClosed, describeErrno("write", error));
    return true;
  }
  if (!outgoing_.empty()) {
    writeArmed_ = true;
    asio::post(ioContext(), [self = shared_from_this()] { self->armWrite(); });
  }
  return true;
}

void Channel::close(CloseCause cause, std::string reason) {
  const std::lock_guard lock(mutex_);
  if (closing_ || closed_) return;
  requestCloseLocked(cause, std::move(reason));
}

void Channel::requestCloseLocked(CloseCause cause, std::string reason) {
  if (closing_) return;
  closing_ = true;
  asio::post(ioContext(), [self = shared_from_this(), cause, reason = std::move(reason)] {
    self->closeNow(cause, reason);
  });
}

void Channel::handled(std::size_t frameLength) {
  if (budget_.release(frameLength)) {
    asio::post(ioContext(), [self = shared_from_this()] { self->continueReading(); });
  }
}

bool Channel::isClosed() const {
  const std::lock_guard lock(mutex_);
  return closing_ || closed_;
}

std::size_t Channel::pendingReplyCount() const {
  const std::lock_guard lock(mutex_);
  return pending_.size();
}

void Channel::armRead() {
  if (closedOnIoThread_ || readArmed_) return;
  readArmed_ = true;
  socket_.async_wait(asio::posix::descriptor_base::wait_read,
                     [self = shared_from_this()](const asio::error_code& error) {
                       self->readArmed_ = false;
                       if (error || self->closedOnIoThread_) return;
                       self->onReadable();
                     });
}

void Channel::onReadable() {
  // Only the I/O thread reads, so one buffer serves every channel.
  static std::array<uint8_t, kReadChunk> buffer;
  const FrameReader::FrameSink sink = [this](RawFrame&& frame) { return dispatch(std::move(frame)); };
  for (int turn = 0; turn < kReadsPerTurn; ++turn) {
    Descriptors descriptors;
    bool truncated = false;
    const ssize_t n = receive(buffer, descriptors, truncated);
    if (truncated) {
      return closeNow(CloseCause::ProtocolViolation,
                      fmt::format("a frame brought more than {} descriptors", kMaxDescriptorsPerFrame));
    }
    if (n > 0) {
      const bool broughtDescriptors = !descriptors.empty();
      const tn::Result<void> read = reader_.consume(std::span(buffer.data(), static_cast<std::size_t>(n)),
                                                    std::move(descriptors), sink);
      if (!read.ok()) return closeNow(CloseCause::ProtocolViolation, read.error().message().value_or(""));
      if (closedOnIoThread_) return;  // the sink found a violation
      // The kernel ends a read after bytes that brought descriptors.
      const bool cutShort = static_cast<std::size_t>(n) < buffer.size() && !broughtDescriptors;
      if (cutShort || budget_.exhausted()) break;
      continue;
    }
    if (n == 0) return closeNow(CloseCause::PeerClosed, "the peer closed the connection");
    if (errno == EINTR) continue;
    if (wouldBlock(errno)) break;
    return closeNow(CloseCause::PeerClosed, describeErrno("read", errno));
  }
  continueReading();
}

ssize_t Channel::receive(std::span<uint8_t> buffer, Descriptors& descriptors, bool& truncated) {
  // Room for one more than a frame may carry, so that a peer sending more
  // is seen as such whatever the kernel's rounding.
  alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(int) * (kMaxDescriptorsPerFrame + 1))> control{};
  iovec piece{buffer.data(), buffer.size()};
  msghdr message{};
  message.msg_iov = &piece;
  message.msg_iovlen = 1;
  message.msg_control = control.data();
  message.msg_controllen = control.size();
  const ssize_t n = ::recvmsg(fd_, &message, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
  if (n < 0) return n;
  // Every descriptor installed is owned at once, so that each path below
  // closes it.
  for (cmsghdr* header = CMSG_FIRSTHDR(&message); header != nullptr; header = CMSG_NXTHDR(&message, header)) {
    if (header->cmsg_level != SOL_SOCKET || header->cmsg_type != SCM_RIGHTS) continue;
    const std::size_t count = (header->cmsg_len - CMSG_LEN(0)) / sizeof(int);
    for (std::size_t i = 0; i < count; ++i) {
      int fd = -1;
      std::memcpy(&fd, CMSG_DATA(header) + i * sizeof(int), sizeof fd);
      descriptors.emplace_back(fd);
    }
  }
  truncated = (message.msg_flags & MSG_CTRUNC) != 0 || descriptors.size() > kMaxDescriptorsPerFrame;
  return n;
}

void Channel::continueReading() {
  for (;;) {
    if (closedOnIoThread_) return;
    while (!heldRequests_.empty() && !budget_.exhausted()) {
      RawFrame frame = std::move(heldRequests_.front());
      heldRequests_.pop_front();
      deliverRequest(std::move(frame));
    }
    if (heldRequests_.empty() && !budget_.exhausted()) return armRead();
    if (budget_.pause()) return;  // handled() resumes
    // The owner caught up while we looked: go on at once.
  }
}

void Channel::deliverRequest(RawFrame frame) {
  budget_.charge(frame.body.size() + kFrameIdsSize);
  callbacks_.request(shared_from_this(), std::move(frame));
}

bool Channel::dispatch(RawFrame frame) {
  if (frame.replyTo == 0) {
    // Requests keep their order: once one waits, the later ones wait too.
    if (budget_.exhausted() || !heldRequests_.empty()) {
      heldRequests_.push_back(std::move(frame));
    } else {
      deliverRequest(std::move(frame));
    }
    return true;
  }
  std::optional<PendingReply> pending;
  {
    const std::lock_guard lock(mutex_);
    pending = pending_.take(frame.replyTo);
  }
  if (!pending) {
    closeNow(CloseCause::ProtocolViolation,
             fmt::format("frame {} replies to id {}, which no request of ours awaits", frame.id, frame.replyTo));
    return false;
  }
  deliverReply(std::move(*pending), std::move(frame));
  return true;
}

void Channel::deliverReply(PendingReply pending, RawFrame frame) {
  const std::size_t length = frame.body.size() + kFrameIdsSize;
  budget_.charge(length);
  // Queued blocks must be copyable; the descriptors ride in a shared box.
  auto descriptors = std::make_shared<Descriptors>(std::move(frame.descriptors));
  pending.queue->async([self = shared_from_this(), handler = std::move(pending.handler),
                        body = std::move(frame.body), descriptors, length] {
    tn::Result<tn::Value> reply = decodeFrameBody(body);
    if (reply.ok()) {
      handler(std::move(reply), std::move(*descriptors));
    } else {
      const std::string reason = reply.error().message().value_or("");
      handler(makeRelayError(RelayErrorCode::ConnectionInvalid, reason), {});
      self->close(CloseCause::ProtocolViolation, reason);
    }
    self->handled(length);
  });
}

void Channel::armWrite() {
  if (closedOnIoThread_) return;
  socket_.async_wait(asio::posix::descriptor_base::wait_write,
                     [self = shared_from_this()](const asio::error_code& error) {
                       if (error || self->closedOnIoThread_) return;
                       self->flush();
                     });
}

void Channel::flush() {
  int error = 0;
  bool more = false;
  {
    const std::lock_guard lock(mutex_);
    if (closed_) return;
    error = writeQueuedLocked();
    more = error == 0 && !outgoing_.empty();
    writeArmed_ = more;
  }
  if (error != 0) return closeNow(CloseCause::PeerClosed, describeErrno("write", error));
  if (more) armWrite();
}

int Channel::writeQueuedLocked() {
  std::array<iovec, kGatherLimit> pieces{};
  while (!outgoing_.empty()) {
    msghdr message{};
    message.msg_iov = pieces.data();
    message.msg_iovlen = outgoing_.gather(pieces);
    alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(int) * kMaxDescriptorsPerFrame)> control{};
    if (const Descriptors& passing = outgoing_.descriptorsToSend(); !passing.empty()) {
      message.msg_control = control.data();
      message.msg_controllen = CMSG_SPACE(sizeof(int) * passing.size());
      cmsghdr* header = CMSG_FIRSTHDR(&message);
      header->cmsg_level = SOL_SOCKET;
      header->cmsg_type = SCM_RIGHTS;
      header->cmsg_len = CMSG_LEN(sizeof(int) * passing.size());
      for (std::size_t i = 0; i < passing.size(); ++i) {
        const int fd = passing[i].get();
        std::memcpy(CMSG_DATA(header) + i * sizeof(int), &fd, sizeof fd);
      }
    }
    const ssize_t n = ::sendmsg(fd_, &message, MSG_DONTWAIT | MSG_NOSIGNAL);
    if (n >= 0) {
      outgoing_.consume(static_cast<std::size_t>(n));
      continue;
    }
    if (errno == EINTR) continue;
    if (wouldBlock(errno)) return 0;
    return errno;
  }
  return 0;
}

void Channel::closeNow(CloseCause cause, const std::string& reason) {
  if (closedOnIoThread_) return;
  closedOnIoThread_ = true;
  heldRequests_.clear();
  std::vector<PendingReply> orphans;
  std::shared_ptr<void> lease;
  {
    const std::lock_guard lock(mutex_);
    if (cause == CloseCause::Cancelled) writeQueuedLocked();  // what the kernel still takes
    closed_ = true;
    orphans = pending_.takeAll();
    outgoing_.clear();
    lease = std::move(lease_);
  }
  asio::error_code ignored;
  socket_.close(ignored);
  lease.reset();
  const std::shared_ptr<Channel> self = shared_from_this();
  const tn::Error error =
      callbacks_.closed ? callbacks_.closed(self, cause, reason)
                        : makeRelayError(RelayErrorCode::ConnectionInvalid, reason);
  for (PendingReply& pending : orphans) {
    pending.queue->async([handler = std::move(pending.handler), error] { handler(error, {}); });
  }
}

}  // namespace relay::detail
