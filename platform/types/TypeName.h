#pragma once

// platform/types: the type hierarchy that hosts and plug-ins speak of
// (library tn_types). See TypeHierarchy.h for the whole; this header: the
// syntax of type names and the case-insensitive comparison of them.
//
// Two kinds of name exist:
//   - MIME types, "major/minor" (RFC 6838 restricted names: a letter or
//     digit, then letters, digits and !#$&-^_.+, each part 1 to 127 bytes);
//   - identifiers declared by Tenon's own type documents, which are not
//     MIME types: 1 to 255 bytes of letters, digits and -._+, no '/'.
// A media range "major/*" names every type of that major type; it is only
// ever the second argument of a conformance question.
//
// Names are compared without regard to ASCII case, both kinds alike (MIME
// types are case-insensitive, and one rule for both is easier to predict).

#include <cstddef>
#include <string>
#include <string_view>

namespace types {

inline constexpr size_t kMaxTypeNameLength = 255;

// ASCII lower case of name.
std::string foldedTypeName(std::string_view name);

// True when a and b are equal without regard to ASCII case.
bool sameTypeName(std::string_view a, std::string_view b);

bool isMimeTypeName(std::string_view name);
bool isDeclaredTypeName(std::string_view name);
// "major/*" with a valid major part.
bool isMediaRange(std::string_view name);
// isMimeTypeName or isDeclaredTypeName.
bool isTypeName(std::string_view name);

// The part before '/', or empty when there is none.
std::string_view majorType(std::string_view name);

// Hash and equality of names without regard to ASCII case, for maps that
// are searched with string_views (no folded copy is made for a lookup).
struct FoldedHash {
  using is_transparent = void;
  size_t operator()(std::string_view name) const;
};
struct FoldedEqual {
  using is_transparent = void;
  bool operator()(std::string_view a, std::string_view b) const { return sameTypeName(a, b); }
};

}  // namespace types
