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
  while (state_ == State::Reading && !input.empty()) {
    const bool headerWasComplete = headerFill_ == kFrameHeaderSize;
    if (!headerWasComplete) {
      const bool complete = fillHeader(input);
      if (tn::Result<void> length = checkLength(); !length.ok()) return fail(length.error());
      if (!complete) break;
      if (tn::Result<void> header = acceptHeader(); !header.ok()) return fail(header.error());
    }
    if (!fillBody(input)) break;
    RawFrame frame{lastId_, loadBigEndian64(header_.data() + kFrameLengthSize + 8), std::move(body_)};
    body_ = tn::Bytes();
    headerFill_ = 0;
    if (!sink(std::move(frame))) state_ = State::SinkStopped;
  }
  if (state_ == State::Failed) return failure_;
  return {};
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
  failure_ = std::move(error);
  return failure_;
}

}  // namespace relay
