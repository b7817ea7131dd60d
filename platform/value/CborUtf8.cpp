#include "platform/value/CborUtf8.h"

#include <cstring>

namespace tn::cbor {
namespace {

bool isContinuation(uint8_t b) { return (b & 0xC0) == 0x80; }

// Length of the valid UTF-8 sequence starting at p (at most `available`
// bytes), or 0 when none starts there. The second byte's range is what rules
// out overlong forms (E0, F0), surrogates (ED) and code points above
// U+10FFFF (F4); C0, C1 and F5..FF never start a sequence.
size_t validSequenceLength(const uint8_t* p, size_t available) {
  const uint8_t lead = p[0];
  if (lead < 0x80) return 1;
  size_t length;
  uint8_t low = 0x80, high = 0xBF;  // allowed range of the second byte
  if (lead >= 0xC2 && lead <= 0xDF) {
    length = 2;
  } else if (lead >= 0xE0 && lead <= 0xEF) {
    length = 3;
    if (lead == 0xE0) low = 0xA0;
    if (lead == 0xED) high = 0x9F;
  } else if (lead >= 0xF0 && lead <= 0xF4) {
    length = 4;
    if (lead == 0xF0) low = 0x90;
    if (lead == 0xF4) high = 0x8F;
  } else {
    return 0;
  }
  if (available < length) return 0;
  if (p[1] < low || p[1] > high) return 0;
  for (size_t i = 2; i < length; ++i)
    if (!isContinuation(p[i])) return 0;
  return length;
}

// Most keys and strings are ASCII: skip eight such bytes at a time.
size_t asciiPrefixLength(const uint8_t* p, size_t size) {
  size_t i = 0;
  for (; i + 8 <= size; i += 8) {
    uint64_t word;
    std::memcpy(&word, p + i, 8);
    if (word & 0x8080808080808080ULL) break;
  }
  while (i < size && p[i] < 0x80) ++i;
  return i;
}

}  // namespace

size_t firstInvalidUtf8(std::string_view text) {
  const auto* p = reinterpret_cast<const uint8_t*>(text.data());
  const size_t size = text.size();
  size_t i = asciiPrefixLength(p, size);
  while (i < size) {
    const size_t length = validSequenceLength(p + i, size - i);
    if (length == 0) return i;
    i += length;
    if (length == 1) i += asciiPrefixLength(p + i, size - i);
  }
  return size;
}

std::string repairedUtf8(std::string_view text) {
  static constexpr std::string_view kReplacement = "\xEF\xBF\xBD";  // U+FFFD
  const auto* p = reinterpret_cast<const uint8_t*>(text.data());
  std::string out;
  out.reserve(text.size() + 8);
  for (size_t i = 0; i < text.size();) {
    const size_t length = validSequenceLength(p + i, text.size() - i);
    if (length == 0) {
      out += kReplacement;
      ++i;
    } else {
      out.append(text.substr(i, length));
      i += length;
    }
  }
  return out;
}

}  // namespace tn::cbor
