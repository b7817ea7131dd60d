#pragma once

// UTF-8 as RFC 3629 defines it (no overlong forms, no surrogates, nothing
// above U+10FFFF): the one validator the wire codec and the document readers
// and writers share.

#include <cstddef>
#include <string>
#include <string_view>

namespace tn {

struct Utf8Sequence {
  char32_t codePoint = 0;
  size_t length = 0;  // 0 when the bytes at the position do not begin a valid sequence
};

// The character whose encoding begins at text[position] (position < size).
Utf8Sequence decodeUtf8At(std::string_view text, size_t position);

// The offset of the first byte that does not begin a valid sequence (a
// sequence cut short by the end counts as invalid), or text.size().
size_t firstInvalidUtf8(std::string_view text);

inline bool isValidUtf8(std::string_view text) { return firstInvalidUtf8(text) == text.size(); }

// text with every byte that does not begin a valid sequence replaced by
// U+FFFD; valid sequences are kept as they are.
std::string repairedUtf8(std::string_view text);

}  // namespace tn
