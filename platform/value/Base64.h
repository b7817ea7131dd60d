#pragma once

// Base64 (RFC 4648, standard alphabet, with padding): how documents carry
// data values, and strings and keys that XML cannot hold as text.

#include <optional>
#include <string>
#include <string_view>

#include "platform/value/Value.h"

namespace tn {

// The base64 text of bytes, padded, on one line.
std::string encodeBase64(std::string_view bytes);
std::string encodeBase64(const Bytes& bytes);

// Decodes base64 text. ASCII whitespace anywhere is ignored (documents wrap
// long data); everything else must be the standard alphabet, padded to a
// multiple of four, with zero bits after the last byte, so that each byte
// string has exactly one accepted form. Returns none otherwise.
std::optional<Bytes> decodeBase64(std::string_view text);
std::optional<std::string> decodeBase64ToString(std::string_view text);

}  // namespace tn
