#include "platform/log/Escape.h"

#include <cstdint>

#include <fmt/format.h>

namespace tn::log {
namespace {

bool isPlainAscii(unsigned char c) { return c >= 0x20 && c < 0x7f && c != '\\'; }

// Code points at or above U+0080 that are written as \uHHHH.
bool isEscapedCodePoint(uint32_t c) {
  return (c >= 0x80 && c <= 0x9f) || c == 0x2028 || c == 0x2029 || (c >= 0x202a && c <= 0x202e) ||
         (c >= 0x2066 && c <= 0x2069);
}

// The length of the valid UTF-8 sequence of two or more bytes at the start
// of text and its code point, or 0 when there is none (RFC 3629: no
// overlong forms, no surrogates, nothing above U+10FFFF).
size_t decodeSequence(std::string_view text, uint32_t& codePoint) {
  const auto byte = [&](size_t i) { return static_cast<unsigned char>(text[i]); };
  const unsigned char lead = byte(0);
  size_t length = 0;
  uint32_t minimum = 0;
  if (lead >= 0xc2 && lead <= 0xdf) {
    length = 2, minimum = 0x80, codePoint = lead & 0x1fu;
  } else if (lead >= 0xe0 && lead <= 0xef) {
    length = 3, minimum = 0x800, codePoint = lead & 0x0fu;
  } else if (lead >= 0xf0 && lead <= 0xf4) {
    length = 4, minimum = 0x10000, codePoint = lead & 0x07u;
  } else {
    return 0;
  }
  if (text.size() < length) return 0;
  for (size_t i = 1; i < length; ++i) {
    if ((byte(i) & 0xc0u) != 0x80) return 0;
    codePoint = (codePoint << 6) | (byte(i) & 0x3fu);
  }
  if (codePoint < minimum || codePoint > 0x10ffff || (codePoint >= 0xd800 && codePoint <= 0xdfff)) return 0;
  return length;
}

void appendControl(std::string& out, unsigned char c) {
  switch (c) {
    case '\n': out += "\\n"; return;
    case '\r': out += "\\r"; return;
    case '\t': out += "\\t"; return;
    case '\\': out += "\\\\"; return;
    default: fmt::format_to(std::back_inserter(out), "\\x{:02x}", c);
  }
}

}  // namespace

bool needsEscaping(std::string_view text) noexcept {
  for (size_t i = 0; i < text.size();) {
    const auto c = static_cast<unsigned char>(text[i]);
    if (isPlainAscii(c)) {
      ++i;
      continue;
    }
    if (c < 0x80) return true;
    uint32_t codePoint = 0;
    const size_t length = decodeSequence(text.substr(i), codePoint);
    if (length == 0 || isEscapedCodePoint(codePoint)) return true;
    i += length;
  }
  return false;
}

void appendEscaped(std::string& out, std::string_view text) {
  out.reserve(out.size() + text.size());
  for (size_t i = 0; i < text.size();) {
    const auto c = static_cast<unsigned char>(text[i]);
    if (isPlainAscii(c)) {
      out += static_cast<char>(c);
      ++i;
    } else if (c < 0x80) {
      appendControl(out, c);
      ++i;
    } else {
      uint32_t codePoint = 0;
      const size_t length = decodeSequence(text.substr(i), codePoint);
      if (length == 0) {
        fmt::format_to(std::back_inserter(out), "\\x{:02x}", c);
        ++i;
      } else if (isEscapedCodePoint(codePoint)) {
        fmt::format_to(std::back_inserter(out), "\\u{:04x}", codePoint);
        i += length;
      } else {
        out.append(text.substr(i, length));
        i += length;
      }
    }
  }
}

std::string escapeText(std::string_view text) {
  std::string out;
  appendEscaped(out, text);
  return out;
}

}  // namespace tn::log
