#pragma once

// The registry's reading of a rules dictionary: which plug-ins certainly
// fail it. The daemon matches every candidate against the rules itself, so
// the registry only leaves out what the daemon's rule matching would refuse
// for sure, and keeps everything it is not sure about.
//
// An entry narrows only when both its key and its pattern are understood:
// - keys: "XTExtensionIdentifier" (the identifier), and every key the
//   daemon reads from the attributes dictionary or the bundle information
//   (any key but "XTUserElection", "com.ostrel.uuid",
//   "XTExtensionContainingApp" and "ENTITLEMENT:..."), which the registry
//   resolves the same way: "XTExtensionAttributes"[key], else the
//   information dictionary's own value;
// - patterns: a string without a leading operator character ('?', '<', '>',
//   '='), or one starting with a single "=" (equality); an array of such
//   strings (any of them); true (present and not false); false (absent or
//   false).
// Everything else (comparisons, "<>", type tests, activation-rule
// dictionaries, unknown kinds) keeps every plug-in. Equality follows the
// daemon's numeric string comparison loosely: runs of digits compare
// without their leading zeros, so the registry never drops a plug-in that
// comparison might call equal.

#include <optional>
#include <string>
#include <string_view>

#include "platform/registrar/Records.h"
#include "platform/value/Value.h"

namespace registrar {

// text with leading zeros removed from each run of decimal digits ("a007.01"
// -> "a7.1"; "000" -> "0"): two strings with equal keys may compare equal
// in the daemon, strings with different keys never do.
std::string equalityKey(std::string_view text);

// The equality operand of a string pattern ("abc" and "=abc" -> "abc"), or
// none when the pattern is another comparison.
std::optional<std::string_view> equalityOperand(const tn::Value& pattern);

// False only when plugIn certainly fails the rules; true otherwise. rules
// must be a dictionary or null.
bool mayMatch(const tn::Value& rules, const PlugInRecord& plugIn);

// When every plug-in that may match has an identifier among a known set,
// that set's equality keys: the "XTExtensionIdentifier" entry with an
// equality pattern or an array of them. None otherwise.
std::optional<std::vector<std::string>> identifierKeys(const tn::Value& rules);

}  // namespace registrar
