// Escape: what a log line may carry. Every message is escaped here, in the
// log layer, before any sink sees it, so no call site can forget to escape a
// string a peer supplied (a path, a bundle identifier, a request's text).
//
// Written as they are: printable ASCII other than the backslash, and valid
// UTF-8 above U+009F except the code points below.
// Escaped:
//   \n \r \t            line feed, carriage return, tab
//   \\                  the backslash itself, so an escape is never ambiguous
//   \xHH                other C0 controls (ESC is \x1b), DEL (\x7f), and each
//                       byte of invalid UTF-8 (stray continuation bytes,
//                       overlong forms, surrogates, beyond U+10FFFF, cut off)
//   \uHHHH              C1 controls U+0080..U+009F, the line and paragraph
//                       separators U+2028 and U+2029, and the bidirectional
//                       embedding, override and isolate controls
//                       (U+202A..U+202E, U+2066..U+2069), which can make a
//                       line display as something else
//
// The result is one line of valid UTF-8 that no terminal interprets.

#pragma once

#include <string>
#include <string_view>

namespace tn::log {

// True when escapeText(text) differs from text.
bool needsEscaping(std::string_view text) noexcept;

// Appends text to out, escaped as above.
void appendEscaped(std::string& out, std::string_view text);

// text escaped as above.
std::string escapeText(std::string_view text);

}  // namespace tn::log
