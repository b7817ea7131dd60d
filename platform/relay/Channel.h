// Channel: one connected socket of a connection, and everything that lives
// exactly as long as it: the frame reader, the outgoing frames, the requests
// waiting for a reply, the inbound budget. A client connection that
// reconnects gets a new channel; a server connection has one.
//
// Threads and ownership:
//   - The I/O thread reads, writes what the kernel would not take at once,
//     accepts replies, and closes. Asio handlers hold the channel alive.
//   - send() runs on the caller's thread: it numbers the frame, registers
//     its reply handler and writes directly to the socket when nothing is
//     queued ahead of it, so a request costs no hop to the I/O thread.
//   - mutex_ guards the outgoing side, the pending replies and closed_; the
//     socket's descriptor is only used under it or on the I/O thread, and it
//     is closed on the I/O thread only after closed_ was set under mutex_,
//     so no thread writes to a descriptor number that was reused.
//
// Internal to platform/relay.

#pragma once

#include <asio/posix/stream_descriptor.hpp>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <string>

#include "platform/relay/FrameReader.h"
#include "platform/relay/InboundBudget.h"
#include "platform/relay/OutgoingBuffer.h"
#include "platform/relay/PendingReplies.h"
#include "platform/relay/UniqueFd.h"
#include "platform/value/Error.h"

namespace relay::detail {

enum class CloseCause {
  PeerClosed,         // end of stream, or the socket reported an error
  ProtocolViolation,  // the peer broke a frame rule
  OutgoingOverflow,   // the peer stopped reading and too much piled up
  Cancelled,          // this side ended it
};

// The most bytes a peer may leave unread before its connection is dropped.
inline constexpr std::size_t kMaxOutgoingBytes = 64u * 1024u * 1024u;

class Channel : public std::enable_shared_from_this<Channel> {
 public:
  struct Callbacks {
    // I/O thread. A request arrived; it is charged to the budget and the
    // owner must call handled(frame length) once it is done with it. While
    // the budget is exhausted, requests already read wait in the channel
    // (at most one read's worth) and are not handed out, so the owner never
    // holds more than the message limit.
    std::function<void(const std::shared_ptr<Channel>&, RawFrame)> request;
    // I/O thread, exactly once, after the socket is closed. Returns the
    // error that the channel's pending reply handlers then receive.
    std::function<tn::Error(const std::shared_ptr<Channel>&, CloseCause, const std::string&)> closed;
  };

  // Takes `socket` (a connected, non-blocking Unix stream socket). `lease`
  // is released when the socket closes (connection accounting).
  static std::shared_ptr<Channel> create(UniqueFd socket, Callbacks callbacks,
                                         std::shared_ptr<void> lease = nullptr,
                                         InboundLimits limits = {});
  ~Channel();
  Channel(const Channel&) = delete;
  Channel& operator=(const Channel&) = delete;

  // Starts reading. Any thread; later calls do nothing.
  void start();

  // Numbers `frame` (encoded with id 0) and sends it after everything sent
  // before it. With `pending`, its handler is registered for the reply
  // before a byte leaves, and moved from. `whenSent` is released once the
  // kernel has taken the whole frame, or the channel closed. Returns false
  // once the channel is closed; then nothing is sent and `pending` is left
  // as it was. Any thread.
  // `descriptors` (at most kMaxDescriptorsPerFrame, checked by the caller)
  // leave with the frame's first byte; the channel closes its copies once
  // the kernel took them, or when it closes.
  bool send(tn::Bytes frame, PendingReply* pending = nullptr, std::shared_ptr<const void> whenSent = nullptr,
            Descriptors descriptors = {});

  // Closes the socket with `cause` unless it is closed already: the
  // callbacks' closed() runs and every pending reply handler receives its
  // error. A Cancelled close first writes what the kernel will still take
  // of the queued frames. Any thread; the close happens on the I/O thread.
  void close(CloseCause cause, std::string reason);

  // A request or reply charged to the budget has been handled. Any thread.
  void handled(std::size_t frameLength);

  // True once a close was requested or happened. Any thread.
  bool isClosed() const;

  // Requests of ours still waiting for their reply. Any thread.
  std::size_t pendingReplyCount() const;

 private:
  Channel(UniqueFd socket, Callbacks callbacks, std::shared_ptr<void> lease, InboundLimits limits);

  // I/O thread.
  void armRead();
  void onReadable();
  // One recvmsg into `buffer`: the byte count (0 at end of stream, -1 with
  // errno) and the descriptors that came with the bytes. Sets `truncated`
  // when the kernel had more descriptors than fit (MSG_CTRUNC).
  ssize_t receive(std::span<uint8_t> buffer, Descriptors& descriptors, bool& truncated);
  bool dispatch(RawFrame frame);
  // Hands out held requests while the budget allows, then reads on, or
  // pauses until handled() frees enough of the budget.
  void continueReading();
  void deliverRequest(RawFrame frame);
  void deliverReply(PendingReply pending, RawFrame frame);
  void armWrite();
  void flush();
  void closeNow(CloseCause cause, const std::string& reason);

  // Needs mutex_: writes queued bytes until the kernel pushes back. Returns
  // 0, or the errno of a failed write.
  int writeQueuedLocked();
  // Needs mutex_: marks the channel closing and has the I/O thread close it.
  void requestCloseLocked(CloseCause cause, std::string reason);

  const int fd_;                            // owned by socket_
  asio::posix::stream_descriptor socket_;   // I/O thread (and construction)
  const Callbacks callbacks_;
  InboundBudget budget_;

  // I/O thread only.
  FrameReader reader_;
  std::deque<RawFrame> heldRequests_;  // read while the budget was exhausted
  bool started_ = false;
  bool readArmed_ = false;
  bool closedOnIoThread_ = false;

  mutable std::mutex mutex_;
  bool closing_ = false;            // guarded by mutex_: a close was requested
  bool closed_ = false;             // guarded by mutex_: the socket is (being) closed
  uint64_t lastSentId_ = 0;         // guarded by mutex_
  OutgoingBuffer outgoing_;         // guarded by mutex_
  bool writeArmed_ = false;         // guarded by mutex_: the I/O thread will flush
  PendingReplies pending_;          // guarded by mutex_
  std::shared_ptr<void> lease_;     // guarded by mutex_
};

}  // namespace relay::detail
