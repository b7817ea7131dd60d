#include "platform/types/TypeName.h"

#include <cstdint>

namespace types {
namespace {

char lower(char c) { return (c >= 'A' && c <= 'Z') ? static_cast<char>(c - 'A' + 'a') : c; }

bool isAlnum(char c) { return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9'); }

// RFC 6838 restricted-name.
bool isRestrictedName(std::string_view part) {
  if (part.empty() || part.size() > 127 || !isAlnum(part.front())) return false;
  for (char c : part.substr(1)) {
    if (!isAlnum(c) && std::string_view("!#$&-^_.+").find(c) == std::string_view::npos) return false;
  }
  return true;
}

}  // namespace

std::string foldedTypeName(std::string_view name) {
  std::string folded(name);
  for (char& c : folded) c = lower(c);
  return folded;
}

bool sameTypeName(std::string_view a, std::string_view b) {
  if (a.size() != b.size()) return false;
  for (size_t i = 0; i < a.size(); ++i) {
    if (lower(a[i]) != lower(b[i])) return false;
  }
  return true;
}

bool isMimeTypeName(std::string_view name) {
  const size_t slash = name.find('/');
  if (slash == std::string_view::npos) return false;
  return isRestrictedName(name.substr(0, slash)) && isRestrictedName(name.substr(slash + 1));
}

bool isDeclaredTypeName(std::string_view name) {
  if (name.empty() || name.size() > kMaxTypeNameLength) return false;
  for (char c : name) {
    if (!isAlnum(c) && c != '-' && c != '.' && c != '_' && c != '+') return false;
  }
  return true;
}

bool isMediaRange(std::string_view name) {
  return name.size() > 2 && name.ends_with("/*") && isRestrictedName(name.substr(0, name.size() - 2));
}

bool isTypeName(std::string_view name) { return isMimeTypeName(name) || isDeclaredTypeName(name); }

std::string_view majorType(std::string_view name) {
  const size_t slash = name.find('/');
  return slash == std::string_view::npos ? std::string_view() : name.substr(0, slash);
}

size_t FoldedHash::operator()(std::string_view name) const {
  // FNV-1a over the folded bytes.
  uint64_t hash = 14695981039346656037ull;
  for (char c : name) {
    hash ^= static_cast<unsigned char>(lower(c));
    hash *= 1099511628211ull;
  }
  return static_cast<size_t>(hash);
}

}  // namespace types
