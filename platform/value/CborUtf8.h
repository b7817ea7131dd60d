#pragma once

// Internal to the CBOR codec: UTF-8 validation as RFC 3629 defines it (no
// overlong forms, no surrogates, nothing above U+10FFFF), and the repair the
// encoder applies to strings that break it.

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

namespace tn::cbor {

// The offset of the first byte of text that does not begin a valid UTF-8
// sequence (a sequence cut short by the end counts as invalid), or
// text.size() when all of it is valid.
size_t firstInvalidUtf8(std::string_view text);

inline bool isValidUtf8(std::string_view text) { return firstInvalidUtf8(text) == text.size(); }

// text with every byte that does not begin a valid sequence replaced by
// U+FFFD; valid sequences are kept as they are.
std::string repairedUtf8(std::string_view text);

}  // namespace tn::cbor
