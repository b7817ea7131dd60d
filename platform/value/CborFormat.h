#pragma once

// Internal to the CBOR codec: the numbers of the format (RFC 8949 section 3)
// shared by encoder and decoder. Not part of the public API.

#include <cstdint>

namespace tn::cbor {

// Major types, the top three bits of an item's initial byte.
enum Major : uint8_t {
  kUnsigned = 0,
  kNegative = 1,
  kByteString = 2,
  kTextString = 3,
  kArray = 4,
  kMap = 5,
  kTag = 6,
  kSimple = 7,  // simple values and floats
};

// Additional information, the low five bits of the initial byte.
inline constexpr uint8_t kOneByteArgument = 24;
inline constexpr uint8_t kTwoByteArgument = 25;
inline constexpr uint8_t kFourByteArgument = 26;
inline constexpr uint8_t kEightByteArgument = 27;
inline constexpr uint8_t kIndefinite = 31;

// Additional information of major type 7.
inline constexpr uint8_t kFalse = 20;
inline constexpr uint8_t kTrue = 21;
inline constexpr uint8_t kNull = 22;
inline constexpr uint8_t kUndefined = 23;
inline constexpr uint8_t kFloat16 = 25;
inline constexpr uint8_t kFloat32 = 26;
inline constexpr uint8_t kFloat64 = 27;

inline constexpr uint8_t initialByte(Major major, uint8_t info) {
  return static_cast<uint8_t>(major << 5 | info);
}

inline constexpr uint64_t kUUIDSize = 16;

}  // namespace tn::cbor
