#pragma once

// Internal to the document readers and writers: the characters XML 1.0 can
// carry as text.

#include <cstddef>
#include <string_view>

#include "platform/value/Utf8.h"

namespace tn::document {

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
