#include "platform/value/XmlPrescan.h"

#include <algorithm>
#include <optional>

#include <fmt/format.h>

#include "platform/value/DocumentUtf8.h"

namespace tn::document {
namespace {

// A reference we accept is at most this long from '&' to ';'
// ("&#x0010FFFF;" with many leading zeros); the search for ';' stops there.
constexpr size_t kLongestReference = 32;

bool isHexDigit(char c) { return (c >= '0' && c <= '9') || (c >= 'a' && c <= 'f') || (c >= 'A' && c <= 'F'); }
bool isDecimalDigit(char c) { return c >= '0' && c <= '9'; }

// What may stand between '&' and ';' of a reference we could accept.
bool isReferenceCharacter(char c) {
  return isDecimalDigit(c) || ((c | 0x20) >= 'a' && (c | 0x20) <= 'z') || c == '#';
}

unsigned hexValue(char c) {
  if (c <= '9') return static_cast<unsigned>(c - '0');
  return static_cast<unsigned>((c | 0x20) - 'a' + 10);
}

// The code point of "#65" or "#x41" (a reference's body without '&' and
// ';'), or none when it is not a character reference. Values above U+10FFFF
// answer U+110000.
std::optional<char32_t> characterReferenceValue(std::string_view body) {
  if (body.size() < 2 || body[0] != '#') return std::nullopt;
  const bool hex = body[1] == 'x';
  std::string_view digits = body.substr(hex ? 2 : 1);
  if (digits.empty()) return std::nullopt;
  uint32_t value = 0;
  for (char c : digits) {
    if (hex ? !isHexDigit(c) : !isDecimalDigit(c)) return std::nullopt;
    value = value * (hex ? 16 : 10) + (hex ? hexValue(c) : static_cast<unsigned>(c - '0'));
    if (value > 0x10FFFF) value = 0x110000;  // stays out of range without overflowing
  }
  return value;
}

class XmlPrescanner {
 public:
  explicit XmlPrescanner(const DocumentInput& input) : input_(input), text_(input.bytes()) {}

  Result<void> run() {
    while (pos_ < text_.size() && !error_) {
      const char c = text_[pos_];
      if (c == '<')
        scanMarkup();
      else if (c == '&')
        checkReference();
      else
        checkCharacter();
    }
    if (error_) return *error_;
    return {};
  }

 private:
  bool startsWith(std::string_view prefix) const { return text_.substr(pos_).starts_with(prefix); }

  void fail(size_t offset, std::string_view reason) {
    error_ = input_.errorAt(offset, DocumentErrorCode::Malformed, reason);
  }

  // Checks the character at pos_ and steps over it.
  void checkCharacter() {
    const auto b = static_cast<uint8_t>(text_[pos_]);
    if (b >= 0x20 && b < 0x80) {
      ++pos_;
      return;
    }
    const Utf8Sequence s = decodeUtf8At(text_, pos_);
    if (s.length == 0) return fail(pos_, "invalid UTF-8");
    if (!isXmlChar(s.codePoint))
      return fail(pos_, fmt::format("character U+{:04X} is not allowed in XML", static_cast<uint32_t>(s.codePoint)));
    pos_ += s.length;
  }

  // Steps over characters, checking each, up to and past terminator (or to
  // the end, where the parser reports the unterminated construct).
  void skipPast(std::string_view terminator) {
    while (pos_ < text_.size() && !error_) {
      if (startsWith(terminator)) {
        pos_ += terminator.size();
        return;
      }
      checkCharacter();
    }
  }

  void scanMarkup() {
    if (startsWith("<!--")) {
      pos_ += 4;
      skipPast("-->");
    } else if (startsWith("<![CDATA[")) {
      pos_ += 9;
      skipPast("]]>");
    } else if (startsWith("<?")) {
      pos_ += 2;
      skipPast("?>");
    } else if (startsWith("<!DOCTYPE")) {
      fail(pos_, "DOCTYPE declarations are not allowed");
    } else if (startsWith("<!")) {
      fail(pos_, "markup declarations are not allowed");
    } else {
      ++pos_;
      scanTag();
    }
  }

  // From just after '<' to just after the closing '>', with attribute values
  // checked on the way.
  void scanTag() {
    while (pos_ < text_.size() && !error_) {
      const char c = text_[pos_];
      if (c == '>') {
        ++pos_;
        return;
      }
      if (c == '<') return;  // malformed; the parser says so
      if (c == '"' || c == '\'') {
        ++pos_;
        scanAttributeValue(c);
      } else {
        checkCharacter();
      }
    }
  }

  void scanAttributeValue(char quote) {
    while (pos_ < text_.size() && !error_) {
      const char c = text_[pos_];
      if (c == quote) {
        ++pos_;
        return;
      }
      if (c == '<') return fail(pos_, "'<' in an attribute value (write &lt;)");
      if (c == '&')
        checkReference();
      else
        checkCharacter();
    }
  }

  // At '&': accepts the predefined entities and character references to
  // XML characters, and steps over the reference.
  void checkReference() {
    const size_t start = pos_;
    const size_t length = text_.substr(start, kLongestReference).find(';') + 1;  // 0 when none
    const std::string_view reference = text_.substr(start, length);
    const std::string_view body = length > 2 ? reference.substr(1, length - 2) : std::string_view();
    if (body.empty() || !std::all_of(body.begin(), body.end(), isReferenceCharacter))
      return fail(start, "'&' that does not begin a reference (write &amp;)");
    if (body[0] == '#') {
      const std::optional<char32_t> c = characterReferenceValue(body);
      if (!c) return fail(start, fmt::format("malformed character reference {}", reference));
      if (!isXmlChar(*c)) return fail(start, fmt::format("character reference {} is not an XML character", reference));
    } else if (body != "amp" && body != "lt" && body != "gt" && body != "quot" && body != "apos") {
      return fail(start, fmt::format("unknown entity {}", reference));
    }
    pos_ = start + length;
  }

  const DocumentInput& input_;
  std::string_view text_;
  size_t pos_ = 0;
  std::optional<Error> error_;
};

}  // namespace

Result<void> prescanXml(const DocumentInput& input) { return XmlPrescanner(input).run(); }

}  // namespace tn::document
