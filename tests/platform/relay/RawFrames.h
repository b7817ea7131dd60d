// Raw frames for tests that speak the wire directly, bypassing Connection.

#pragma once

#include <cstdint>

#include "platform/relay/Frame.h"
#include "platform/value/Cbor.h"
#include "platform/value/Value.h"

namespace relay::test {

// A frame with any header values around the CBOR of `body` (which may be
// anything, not only a map).
inline tn::Bytes rawFrameWithBody(uint64_t id, uint64_t replyTo, const tn::Bytes& body) {
  tn::Bytes frame(kFrameHeaderSize);
  storeBigEndian32(frame.data(), static_cast<uint32_t>(kFrameIdsSize + body.size()));
  storeBigEndian64(frame.data() + kFrameLengthSize, id);
  storeBigEndian64(frame.data() + kFrameLengthSize + 8, replyTo);
  frame.insert(frame.end(), body.begin(), body.end());
  return frame;
}

inline tn::Bytes rawFrame(uint64_t id, uint64_t replyTo, const tn::Value& body) {
  return rawFrameWithBody(id, replyTo, tn::encodeCbor(body));
}

// A map body whose value nests `depth` maps deep in total ({"k": {"k": ...}}).
inline tn::Bytes nestedBody(int depth) {
  tn::Bytes body;
  for (int i = 1; i < depth; ++i) {
    body.insert(body.end(), {0xa1, 0x61, 'k'});
  }
  body.push_back(0xa0);
  return body;
}

}  // namespace relay::test
