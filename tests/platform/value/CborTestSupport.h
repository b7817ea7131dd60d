#pragma once

// Helpers shared by the CBOR, typed-encoding and message-value tests.

#include <bit>
#include <cstdint>
#include <string>
#include <string_view>

#include "platform/value/Value.h"

namespace tn::test {

// "82 01 81 02" or "82018102" → bytes. Spaces are ignored.
inline Bytes hexBytes(std::string_view text) {
  Bytes out;
  auto nibble = [](char c) { return c <= '9' ? c - '0' : (c | 0x20) - 'a' + 10; };
  for (size_t i = 0; i < text.size();) {
    if (text[i] == ' ') {
      ++i;
      continue;
    }
    out.push_back(static_cast<uint8_t>(nibble(text[i]) << 4 | nibble(text[i + 1])));
    i += 2;
  }
  return out;
}

inline std::string toHex(const Bytes& bytes) {
  static constexpr char kDigits[] = "0123456789abcdef";
  std::string out;
  for (uint8_t b : bytes) {
    out.push_back(kDigits[b >> 4]);
    out.push_back(kDigits[b & 15]);
  }
  return out;
}

// Value::identical, but doubles and dates must also have the same bits (so
// -0.0 against 0.0 or a changed NaN payload counts as a difference) and
// dictionaries the same order.
inline bool bitIdentical(const Value& a, const Value& b) {
  if (!Value::identical(a, b)) return false;
  switch (a.kind()) {
    case Value::Kind::Double:
      return std::bit_cast<uint64_t>(*a.real()) == std::bit_cast<uint64_t>(*b.real());
    case Value::Kind::Date:
      return std::bit_cast<uint64_t>(a.date()->secondsSince1970) ==
             std::bit_cast<uint64_t>(b.date()->secondsSince1970);
    case Value::Kind::Array:
      for (size_t i = 0; i < a.array()->size(); ++i)
        if (!bitIdentical((*a.array())[i], (*b.array())[i])) return false;
      return true;
    case Value::Kind::Dictionary:
      for (size_t i = 0; i < a.dictionary()->size(); ++i) {
        const auto& x = a.dictionary()->entries()[i];
        const auto& y = b.dictionary()->entries()[i];
        if (x.first != y.first || !bitIdentical(x.second, y.second)) return false;
      }
      return true;
    default:
      return true;
  }
}

// What the plain wire mapping gives back for v: every non-negative int64
// becomes a uint64; everything else is kept.
inline Value afterWire(const Value& v) {
  if (auto i = v.int64(); i && v.kind() == Value::Kind::Int && *i >= 0) return Value(static_cast<uint64_t>(*i));
  if (const Array* array = v.array()) {
    Array out;
    for (const Value& element : *array) out.push_back(afterWire(element));
    return Value(std::move(out));
  }
  if (const Dictionary* dictionary = v.dictionary()) {
    Dictionary out;
    for (const auto& [key, value] : *dictionary) out.set(key, afterWire(value));
    return Value(std::move(out));
  }
  return v;
}

}  // namespace tn::test
