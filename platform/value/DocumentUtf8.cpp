#include "platform/value/DocumentUtf8.h"

#include <cstdint>

namespace tn::document {

bool isXmlText(std::string_view text) {
  size_t i = 0;
  while (i < text.size()) {
    const auto b = static_cast<uint8_t>(text[i]);
    if (b >= 0x20 && b < 0x80) {
      ++i;
      continue;
    }
    const Utf8Sequence s = decodeUtf8At(text, i);
    if (s.length == 0 || !isXmlChar(s.codePoint)) return false;
    i += s.length;
  }
  return true;
}

}  // namespace tn::document
