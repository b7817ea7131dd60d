#pragma once

// Internal to the document readers and writers: UTF-8 as RFC 3629 defines it
// (no overlong forms, no surrogates, nothing above U+10FFFF) and the
// characters XML 1.0 can carry as text.

#include <cstddef>
#include <string_view>

namespace tn::document {

struct Utf8Sequence {
  char32_t codePoint = 0;
  size_t length = 0;  // 0 when the bytes at the position do not begin a valid sequence
};

// The character whose encoding begins at text[position] (position < size).
Utf8Sequence decodeUtf8At(std::string_view text, size_t position);

// The offset of the first byte that does not begin a valid sequence (a
// sequence cut short by the end counts as invalid), or text.size().
size_t firstInvalidUtf8(std::string_view text);

// XML 1.0's Char production: tab, LF, CR, U+0020-U+D7FF, U+E000-U+FFFD,
// U+10000-U+10FFFF.
inline bool isXmlChar(char32_t c) {
  return c == 0x9 || c == 0xA || c == 0xD || (c >= 0x20 && c <= 0xD7FF) || (c >= 0xE000 && c <= 0xFFFD) ||
         (c >= 0x10000 && c <= 0x10FFFF);
}

// True when text is valid UTF-8 made only of XML characters, so an XML
// document can carry it as text (escaped as need be).
bool isXmlText(std::string_view text);

}  // namespace tn::document
