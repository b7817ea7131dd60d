// Fuzzes the escaping every log line goes through: whatever bytes a peer
// sends, the escaped text is one line of printable ASCII and valid UTF-8
// with no control character, and text that needs no escaping is unchanged.

#include <cstdint>
#include <cstdlib>
#include <string>
#include <string_view>

#include "platform/log/Escape.h"

namespace {

// Valid UTF-8 without C0, DEL or C1 controls (the escaped text's promise).
bool isCleanLine(std::string_view text) {
  for (size_t i = 0; i < text.size();) {
    const auto c = static_cast<unsigned char>(text[i]);
    if (c < 0x20 || c == 0x7f) return false;
    size_t length = c < 0x80 ? 1 : c >= 0xf0 ? 4 : c >= 0xe0 ? 3 : 2;
    if (c >= 0x80 && (c < 0xc2 || c > 0xf4)) return false;
    if (i + length > text.size()) return false;
    for (size_t k = 1; k < length; ++k)
      if ((static_cast<unsigned char>(text[i + k]) & 0xc0) != 0x80) return false;
    if (c == 0xc2 && static_cast<unsigned char>(text[i + 1]) < 0xa0) return false;  // C1
    i += length;
  }
  return true;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string_view input(reinterpret_cast<const char*>(data), size);
  const std::string escaped = tn::log::escapeText(input);
  if (!isCleanLine(escaped)) std::abort();
  if (!tn::log::needsEscaping(input) && escaped != input) std::abort();
  if (tn::log::needsEscaping(input) && escaped == input) std::abort();
  return 0;
}
