#include "platform/relay/Frame.h"

#include <fmt/format.h>

#include "platform/relay/RelayError.h"
#include "platform/value/Cbor.h"

namespace relay {

tn::Result<tn::Bytes> encodeFrame(const tn::Value& body, uint64_t replyTo, uint64_t id) {
  if (!body.isDictionary()) {
    return makeRelayError(RelayErrorCode::NotAMessage,
                          fmt::format("a message body must be a dictionary, not {}",
                                      tn::Value::kindName(body.kind())));
  }
  tn::Bytes frame(kFrameHeaderSize);
  tn::appendCbor(frame, body);
  const std::size_t bodySize = frame.size() - kFrameHeaderSize;
  if (bodySize > kMaxBodySize) {
    return makeRelayError(RelayErrorCode::MessageTooLarge,
                          fmt::format("message body of {} bytes exceeds the limit of {} bytes",
                                      bodySize, kMaxBodySize));
  }
  storeBigEndian32(frame.data(), static_cast<uint32_t>(kFrameIdsSize + bodySize));
  storeBigEndian64(frame.data() + kFrameLengthSize, id);
  storeBigEndian64(frame.data() + kFrameLengthSize + 8, replyTo);
  return frame;
}

void setFrameId(std::span<uint8_t> frame, uint64_t id) {
  storeBigEndian64(frame.data() + kFrameLengthSize, id);
}

void storeBigEndian32(uint8_t* out, uint32_t value) {
  for (int i = 3; i >= 0; --i) {
    out[i] = static_cast<uint8_t>(value);
    value >>= 8;
  }
}

void storeBigEndian64(uint8_t* out, uint64_t value) {
  for (int i = 7; i >= 0; --i) {
    out[i] = static_cast<uint8_t>(value);
    value >>= 8;
  }
}

uint32_t loadBigEndian32(const uint8_t* in) {
  uint32_t value = 0;
  for (int i = 0; i < 4; ++i) value = (value << 8) | in[i];
  return value;
}

uint64_t loadBigEndian64(const uint8_t* in) {
  uint64_t value = 0;
  for (int i = 0; i < 8; ++i) value = (value << 8) | in[i];
  return value;
}

}  // namespace relay
