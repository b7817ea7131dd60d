#include "platform/relay/FrameReader.h"

#include <algorithm>
#include <utility>

#include <fmt/format.h>

#include "platform/relay/RelayError.h"
#include "platform/value/Cbor.h"

namespace relay {
namespace {

// The smallest buffer reserved for a body that arrives in pieces.
constexpr std::size_t kInitialBodyReserve = 4096;

tn::Error violation(std::string message) {
  return makeRelayError(RelayErrorCode::ProtocolViolation, std::move(message));
}

}  // namespace

tn::Result<tn::Value> decodeFrameBody(std::span<const uint8_t> body) {
  tn::Result<tn::Value> decoded = tn::decodeMessageBody(body);
  if (!decoded.ok()) {
    return violation(fmt::format("invalid message body: {}", decoded.error().localizedDescription()));
  }
  return decoded;
}

tn::Result<void> FrameReader::consume(std::span<const uint8_t> input, const FrameSink& sink) {
  return consumeBytes(input, nullptr, sink);
}

tn::Result<void> FrameReader::consume(std::span<const uint8_t> input, Descriptors descriptors,
                                      const FrameSink& sink) {
  if (descriptors.empty()) return consumeBytes(input, nullptr, sink);
  if (state_ == State::Reading && descriptors.size() > maxDescriptors_) {
    return fail(violation(fmt::format("a frame brought {} descriptors; this connection accepts at most {}",
                                      descriptors.size(), maxDescriptors_)));
  }
  return consumeBytes(input, &descriptors, sink);
}

tn::Result<void> FrameReader::consumeBytes(std::span<const uint8_t> input, Descriptors* arriving,
                                           const FrameSink& sink) {
  // With descriptors in the read, the last frame completed in it is held
  // back until it is known whether another frame begins after it.
  std::optional<RawFrame> lastComplete;
  bool currentBegunHere = false;  // the frame being assembled began in this read
  while (state_ == State::Reading && !input.empty()) {
    const bool headerWasComplete = headerFill_ == kFrameHeaderSize;
    if (!headerWasComplete) {
      if (headerFill_ == 0 && arriving != nullptr) {
        currentBegunHere = true;
        if (lastComplete) {
          emit(std::move(*lastComplete), sink);
          lastComplete.reset();
          if (state_ != State::Reading) break;
        }
      }
      const bool complete = fillHeader(input);
      if (tn::Result<void> length = checkLength(); !length.ok()) return fail(length.error());
      if (!complete) break;
      if (tn::Result<void> header = acceptHeader(); !header.ok()) return fail(header.error());
    }
    if (!fillBody(input)) break;
    RawFrame frame{lastId_, loadBigEndian64(header_.data() + kFrameLengthSize + 8), std::move(body_),
                   std::move(inProgressDescriptors_)};
    body_ = tn::Bytes();
    inProgressDescriptors_ = Descriptors();
    headerFill_ = 0;
    if (currentBegunHere) {
      lastComplete = std::move(frame);
    } else {
      emit(std::move(frame), sink);
    }
    currentBegunHere = false;
  }
  if (state_ == State::Failed) return failure_;
  if (arriving == nullptr || state_ == State::SinkStopped) return {};
  return placeDescriptors(*arriving, lastComplete, currentBegunHere, sink);
}

tn::Result<void> FrameReader::placeDescriptors(Descriptors& arriving, std::optional<RawFrame>& lastComplete,
                                               bool frameBegunInProgress, const FrameSink& sink) {
  if (frameBegunInProgress) {
    // The frame still arriving began last: the descriptors are its own.
    if (lastComplete) emit(std::move(*lastComplete), sink);
    inProgressDescriptors_ = std::move(arriving);
    return {};
  }
  if (lastComplete) {
    lastComplete->descriptors = std::move(arriving);
    emit(std::move(*lastComplete), sink);
    return {};
  }
  return fail(violation(fmt::format("{} descriptors arrived in the middle of a frame", arriving.size())));
}

void FrameReader::emit(RawFrame&& frame, const FrameSink& sink) {
  if (state_ != State::Reading) return;
  if (!sink(std::move(frame))) state_ = State::SinkStopped;
}

bool FrameReader::fillHeader(std::span<const uint8_t>& input) {
  const std::size_t take = std::min(kFrameHeaderSize - headerFill_, input.size());
  std::copy_n(input.begin(), take, header_.begin() + static_cast<std::ptrdiff_t>(headerFill_));
  headerFill_ += take;
  input = input.subspan(take);
  return headerFill_ == kFrameHeaderSize;
}

tn::Result<void> FrameReader::checkLength() const {
  if (headerFill_ < kFrameLengthSize) return {};
  const uint32_t length = loadBigEndian32(header_.data());
  if (length < kFrameIdsSize) {
    return violation(fmt::format("frame length {} is below the minimum of {}", length, kFrameIdsSize));
  }
  if (length > kMaxFrameLength) {
    return violation(fmt::format("frame length {} exceeds the limit of {}", length, kMaxFrameLength));
  }
  return {};
}

tn::Result<void> FrameReader::acceptHeader() {
  const uint64_t id = loadBigEndian64(header_.data() + kFrameLengthSize);
  if (id == 0) return violation("frame id 0 is not allowed");
  if (id <= lastId_) {
    return violation(fmt::format("frame id {} does not follow the previous id {}", id, lastId_));
  }
  lastId_ = id;
  bodyExpected_ = loadBigEndian32(header_.data()) - kFrameIdsSize;
  return {};
}

bool FrameReader::fillBody(std::span<const uint8_t>& input) {
  const std::size_t take = std::min(bodyExpected_ - body_.size(), input.size());
  const std::size_t needed = body_.size() + take;
  if (needed > body_.capacity()) {
    // Whole frames in the input get an exact buffer; a body arriving in
    // pieces grows geometrically, bounded by what was announced.
    const std::size_t grown = needed == bodyExpected_
                                  ? needed
                                  : std::max({needed, 2 * body_.capacity(), kInitialBodyReserve});
    body_.reserve(std::min(grown, bodyExpected_));
  }
  body_.insert(body_.end(), input.begin(), input.begin() + static_cast<std::ptrdiff_t>(take));
  input = input.subspan(take);
  return body_.size() == bodyExpected_;
}

tn::Result<void> FrameReader::fail(tn::Error error) {
  state_ = State::Failed;
  inProgressDescriptors_.clear();
  failure_ = std::move(error);
  return failure_;
}

}  // namespace relay
