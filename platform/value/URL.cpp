#include "platform/value/URL.h"

#include "platform/value/PercentDecoding.h"

#include <cctype>

namespace tn {
namespace {

bool isUnreserved(unsigned char c) {
  return std::isalnum(c) || c == '-' || c == '.' || c == '_' || c == '~';
}

// Characters a path keeps unescaped besides the unreserved ones.
bool isPathSafe(unsigned char c) {
  return c == '/' || c == '!' || c == '$' || c == '&' || c == '\'' || c == '(' || c == ')' ||
         c == '*' || c == '+' || c == ',' || c == ';' || c == '=' || c == ':' || c == '@';
}

bool isSchemeChar(char c, bool first) {
  if (std::isalpha(static_cast<unsigned char>(c))) return true;
  return !first && (std::isdigit(static_cast<unsigned char>(c)) || c == '+' || c == '-' || c == '.');
}

}  // namespace

URL URL::fileURLWithPath(std::string_view path) {
  URL u;
  u.scheme_ = "file";
  u.path_ = std::string(path);
  return u;
}

std::optional<URL> URL::parse(std::string_view text) {
  // A NUL, raw or escaped, names nothing: file-system calls would see only
  // the text before it.
  if (text.find('\0') != std::string_view::npos) return std::nullopt;
  const size_t colon = text.find(':');
  if (colon == std::string_view::npos || colon == 0) return std::nullopt;
  for (size_t i = 0; i < colon; ++i)
    if (!isSchemeChar(text[i], i == 0)) return std::nullopt;
  URL u;
  for (size_t i = 0; i < colon; ++i) u.scheme_.push_back(static_cast<char>(std::tolower(text[i])));
  std::string_view rest = text.substr(colon + 1);
  if (rest.substr(0, 2) == "//") {
    rest.remove_prefix(2);
    const size_t slash = rest.find('/');
    u.host_ = std::string(rest.substr(0, slash));
    rest = slash == std::string_view::npos ? std::string_view() : rest.substr(slash);
  }
  // Query and fragment have no meaning for the URLs of this system.
  rest = rest.substr(0, rest.find_first_of("?#"));
  auto path = percentDecode(rest);
  if (!path) return std::nullopt;
  u.path_ = std::move(*path);
  return u;
}

std::string URL::absoluteString() const {
  // A relative path has no authority part ("file:relative/p"), so that parsing
  // the text does not take its first segment for a host.
  const bool relative = host_.empty() && (path_.empty() || path_.front() != '/');
  std::string out = relative ? scheme_ + ":" : scheme_ + "://" + host_;
  static constexpr char kHex[] = "0123456789ABCDEF";
  for (char ch : path_) {
    const auto c = static_cast<unsigned char>(ch);
    if (isUnreserved(c) || isPathSafe(c)) {
      out.push_back(ch);
    } else {
      out.push_back('%');
      out.push_back(kHex[c >> 4]);
      out.push_back(kHex[c & 0xF]);
    }
  }
  return out;
}

}  // namespace tn

namespace tn {
namespace {

int hexDigit(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

}  // namespace

std::optional<std::string> percentDecode(std::string_view text) {
  std::string out;
  out.reserve(text.size());
  for (size_t i = 0; i < text.size(); ++i) {
    if (text[i] != '%') {
      out.push_back(text[i]);
      continue;
    }
    if (i + 2 >= text.size()) return std::nullopt;
    const int high = hexDigit(text[i + 1]);
    const int low = hexDigit(text[i + 2]);
    if (high < 0 || low < 0) return std::nullopt;
    const char c = static_cast<char>(high << 4 | low);
    if (c == '\0') return std::nullopt;
    out.push_back(c);
    i += 2;
  }
  return out;
}

}  // namespace tn
