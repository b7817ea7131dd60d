#include "platform/value/Utf8.h"

#include <cstdint>

namespace tn {

Utf8Sequence decodeUtf8At(std::string_view text, size_t position) {
  const auto byte = [&](size_t i) { return static_cast<uint8_t>(text[i]); };
  const uint8_t lead = byte(position);
  if (lead < 0x80) return {lead, 1};
  // The lead byte gives the length, its payload bits and the smallest code
  // point that length may encode (anything smaller is an overlong form).
  size_t length = 0;
  char32_t c = 0;
  char32_t minimum = 0;
  if (lead >= 0xC2 && lead <= 0xDF) {
    length = 2;
    c = lead & 0x1F;
    minimum = 0x80;
  } else if (lead >= 0xE0 && lead <= 0xEF) {
    length = 3;
    c = lead & 0x0F;
    minimum = 0x800;
  } else if (lead >= 0xF0 && lead <= 0xF4) {
    length = 4;
    c = lead & 0x07;
    minimum = 0x10000;
  } else {
    return {};  // a continuation byte, an overlong lead (C0, C1) or F5-FF
  }
  if (text.size() - position < length) return {};
  for (size_t i = 1; i < length; ++i) {
    const uint8_t continuation = byte(position + i);
    if ((continuation & 0xC0) != 0x80) return {};
    c = (c << 6) | (continuation & 0x3F);
  }
  if (c < minimum || c > 0x10FFFF || (c >= 0xD800 && c <= 0xDFFF)) return {};
  return {c, length};
}

size_t firstInvalidUtf8(std::string_view text) {
  size_t i = 0;
  while (i < text.size()) {
    if (static_cast<uint8_t>(text[i]) < 0x80) {
      ++i;
      continue;
    }
    const Utf8Sequence s = decodeUtf8At(text, i);
    if (s.length == 0) return i;
    i += s.length;
  }
  return text.size();
}

std::string repairedUtf8(std::string_view text) {
  static constexpr std::string_view kReplacement = "\xEF\xBF\xBD";  // U+FFFD
  std::string out;
  out.reserve(text.size() + 8);
  for (size_t i = 0; i < text.size();) {
    const size_t length = static_cast<uint8_t>(text[i]) < 0x80 ? 1 : decodeUtf8At(text, i).length;
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

}  // namespace tn
