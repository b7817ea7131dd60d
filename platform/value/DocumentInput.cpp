#include "platform/value/DocumentInput.h"

#include <algorithm>

#include <fmt/format.h>

#include "platform/value/DocumentUtf8.h"

namespace tn::document {

size_t DocumentInput::lineAt(size_t offset) const {
  const size_t end = std::min(offset, bytes_.size());
  size_t line = 1;
  for (size_t i = 0; i < end; ++i) {
    if (bytes_[i] == '\n') ++line;
    // A CR followed by LF is counted once, at the LF.
    else if (bytes_[i] == '\r' && (i + 1 >= bytes_.size() || bytes_[i + 1] != '\n')) ++line;
  }
  return line;
}

size_t DocumentInput::skipWhitespace(size_t offset) const {
  while (offset < bytes_.size() && isDocumentWhitespace(bytes_[offset])) ++offset;
  return offset;
}

Error DocumentInput::errorAt(size_t offset, DocumentErrorCode code, std::string_view reason) const {
  return documentError(code, fmt::format("{}:{}: {}", name_, lineAt(offset), reason));
}

Error documentError(DocumentErrorCode code, std::string message) {
  return Error(std::string(kDocumentErrorDomain), static_cast<int64_t>(code), std::move(message));
}

std::string quotedForMessage(std::string_view text) {
  constexpr size_t kShown = 60;
  std::string out = "\"";
  size_t i = 0;
  while (i < text.size() && i < kShown) {
    const char c = text[i];
    switch (c) {
      case '"': out += "\\\""; break;
      case '\\': out += "\\\\"; break;
      case '\n': out += "\\n"; break;
      case '\r': out += "\\r"; break;
      case '\t': out += "\\t"; break;
      default:
        if (static_cast<unsigned char>(c) >= 0x80) {
          // Whole characters, and the bytes of broken ones escaped, so the
          // message stays valid UTF-8.
          const Utf8Sequence s = decodeUtf8At(text, i);
          if (s.length == 0) {
            out += fmt::format("\\x{:02x}", static_cast<unsigned char>(c));
          } else {
            out.append(text.substr(i, s.length));
            i += s.length;
            continue;
          }
        } else if (static_cast<unsigned char>(c) < 0x20 || c == 0x7f) {
          out += fmt::format("\\u{:04x}", static_cast<unsigned>(c));
        } else {
          out.push_back(c);
        }
    }
    ++i;
  }
  if (i < text.size()) out += "...";
  out.push_back('"');
  return out;
}

}  // namespace tn::document
