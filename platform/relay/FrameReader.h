// FrameReader: turns the bytes of one direction of a connection into frames.
//
// A pure state machine over byte buffers, independent of sockets, so that it
// can be unit-tested at every split point and fuzzed. It enforces the frame
// rules that need no knowledge of what this side sent:
//   - length between 16 and kMaxFrameLength, checked as soon as its 4 bytes
//     are in, before anything is allocated for the body;
//   - id non-zero and strictly greater than the previous frame's id.
// Memory: the body of an incomplete frame grows with the bytes that actually
// arrived (to at most twice those, or 4 KiB), not with the length the peer
// announced. Bodies are handed out still encoded; the relay decodes them on
// the queue that receives them (decodeFrameBody).
//
// Descriptors (Descriptors.h) that arrive with a read belong to the last
// frame that begins in that read: the sender writes a frame that carries
// descriptors in a write of its own, starting at the frame's first byte,
// and the kernel ends a read after the bytes that brought descriptors, so
// no later frame can begin in the same read. Descriptors in a read in which
// no frame begins, or more than the reader accepts per frame, are a
// violation. Descriptors of a frame that is never completed or never handed
// out (a violation, a stopped reader) are closed with the reader or the
// input; none is ever leaked.
//
// Threads: none of its own; one reader must be used by one thread at a time.

#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <optional>
#include <span>

#include "platform/relay/Descriptors.h"
#include "platform/relay/Frame.h"
#include "platform/value/Error.h"
#include "platform/value/Result.h"
#include "platform/value/Value.h"

namespace relay {

// One frame as read, body still CBOR.
struct RawFrame {
  uint64_t id = 0;
  uint64_t replyTo = 0;  // 0 for a request
  tn::Bytes body;
  Descriptors descriptors = {};  // what came with the frame; empty for most
};

// Decodes a frame body: one CBOR map filling the bytes. A refusal is a
// ProtocolViolation error whose message carries the CBOR error.
tn::Result<tn::Value> decodeFrameBody(std::span<const uint8_t> body);

class FrameReader {
 public:
  // Receives each complete frame in order. Returning false stops the reader
  // for good (the caller found a violation of its own, such as a reply to an
  // unknown request); consume() then returns ok without reading further.
  using FrameSink = std::function<bool(RawFrame&&)>;

  // Reads `input`, handing every frame it completes to `sink`. Returns a
  // ProtocolViolation error for a frame that breaks the rules above; the
  // reader is then failed and every later call returns that error. After the
  // sink stopped it, consume() ignores its input.
  tn::Result<void> consume(std::span<const uint8_t> input, const FrameSink& sink);

  // The same for a read that brought `descriptors` with its bytes (see
  // above). They go to the frame they belong to, or are closed.
  tn::Result<void> consume(std::span<const uint8_t> input, Descriptors descriptors, const FrameSink& sink);

  // How many descriptors one frame may bring; more is a violation. 0 (the
  // default) refuses every frame that brings any.
  void setMaxDescriptorsPerFrame(std::size_t limit) { maxDescriptors_ = limit; }
  std::size_t maxDescriptorsPerFrame() const { return maxDescriptors_; }

  // True once a violation was found or the sink stopped the reader.
  bool stopped() const { return state_ != State::Reading; }

  // Bytes held for the frame in progress (header and body so far).
  std::size_t bufferedBytes() const { return headerFill_ + body_.size(); }

  // The id of the last frame whose header was accepted, 0 before the first.
  uint64_t lastId() const { return lastId_; }

 private:
  enum class State { Reading, Failed, SinkStopped };

  // Copies header bytes from input; true once all kFrameHeaderSize are in.
  bool fillHeader(std::span<const uint8_t>& input);
  tn::Result<void> checkLength() const;
  tn::Result<void> acceptHeader();
  // Copies body bytes from input; true once the body is complete.
  bool fillBody(std::span<const uint8_t>& input);
  tn::Result<void> fail(tn::Error error);
  // The loop behind both consume()s; `arriving` is null when the read
  // brought no descriptors.
  tn::Result<void> consumeBytes(std::span<const uint8_t> input, Descriptors* arriving, const FrameSink& sink);
  // Hands out `frame`, stopping the reader when the sink says so.
  void emit(RawFrame&& frame, const FrameSink& sink);
  // Places the descriptors of a read once it has been consumed.
  tn::Result<void> placeDescriptors(Descriptors& arriving, std::optional<RawFrame>& lastComplete,
                                    bool frameBegunInProgress, const FrameSink& sink);

  State state_ = State::Reading;
  tn::Error failure_;
  std::array<uint8_t, kFrameHeaderSize> header_{};
  std::size_t headerFill_ = 0;
  std::size_t bodyExpected_ = 0;  // valid once the header is complete
  tn::Bytes body_;
  uint64_t lastId_ = 0;
  std::size_t maxDescriptors_ = 0;
  Descriptors inProgressDescriptors_;  // of the frame in progress, which began in an earlier read
};

}  // namespace relay
