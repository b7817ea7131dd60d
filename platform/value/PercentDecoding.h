#pragma once

// Percent-decoding ("%2F" -> '/'), shared by URLs and sandbox tokens.

#include <optional>
#include <string>
#include <string_view>

namespace tn {

// `text` with every "%XX" (hexadecimal, either case) replaced by its byte.
// None for a truncated or malformed escape ("%G1", a final "%4") and for an
// escaped NUL, which no path or name may hold.
std::optional<std::string> percentDecode(std::string_view text);

}  // namespace tn
