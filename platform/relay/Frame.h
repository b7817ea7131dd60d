// Frame: the unit of the wire.
//
//   length   u32 big-endian: bytes that follow (16 + body), 16 .. kMaxFrameLength
//   id       u64 big-endian: non-zero, strictly increasing per connection and direction
//   replyTo  u64 big-endian: the id of the request this frame answers; 0 for a request
//   body     one CBOR map (platform/value/Cbor.h, decodeMessageBody)
//
// This file has the constants and the writing side; FrameReader.h reads.

#pragma once

#include <cstddef>
#include <cstdint>
#include <span>

#include "platform/value/Result.h"
#include "platform/value/Value.h"

namespace relay {

inline constexpr std::size_t kFrameLengthSize = 4;
// id and replyTo: the part of `length` that is not body.
inline constexpr uint32_t kFrameIdsSize = 16;
inline constexpr std::size_t kFrameHeaderSize = kFrameLengthSize + kFrameIdsSize;
// The largest `length` a frame may declare (16 MiB), so the largest body is
// kMaxFrameLength - 16 bytes.
inline constexpr uint32_t kMaxFrameLength = 16u * 1024u * 1024u;
inline constexpr std::size_t kMaxBodySize = kMaxFrameLength - kFrameIdsSize;

// Encodes one frame whose body is `body`, with `id` and `replyTo`. The id may
// be left 0 and set later with setFrameId (the relay numbers frames only when
// it queues them, so that ids follow the order on the wire). Fails with
// NotAMessage when body is not a dictionary, MessageTooLarge when it encodes
// to more than kMaxBodySize bytes.
tn::Result<tn::Bytes> encodeFrame(const tn::Value& body, uint64_t replyTo, uint64_t id = 0);

// Overwrites the id of an encoded frame (frame.size() >= kFrameHeaderSize).
void setFrameId(std::span<uint8_t> frame, uint64_t id);

// Big-endian helpers shared by the reader and the tests' raw frames.
void storeBigEndian32(uint8_t* out, uint32_t value);
void storeBigEndian64(uint8_t* out, uint64_t value);
uint32_t loadBigEndian32(const uint8_t* in);
uint64_t loadBigEndian64(const uint8_t* in);

}  // namespace relay
