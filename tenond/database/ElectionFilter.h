#pragma once

// The election filter of the registry query: the "XTUserElection" entry of
// a host's rules, read as a list of election strings ("0", "1", ...) that a
// candidate's election must be one of.
//
// Only equality is understood here. A string is an election as it stands
// ("1") or after one leading "=" ("=1"); anything else ("<1", ">0", "",
// a number) cannot be understood, and then the whole entry is ignored by
// the query: the rules matching that follows decides on its own, so ignoring
// is never wrong, only slower.
//
// A candidate's election is its stored annotation's "election" (its low 8
// bits, as an unsigned byte: -1 reads as "255"), or, when none is stored, 1
// for a plug-in whose auto-elect entitlement is a true number and 0 for
// every other.

#include <optional>
#include <string>
#include <vector>

#include "platform/value/Value.h"

namespace tnd {

using ElectionFilter = std::vector<std::string>;

// The filter of `rules` (a dictionary or null), or none when it has no
// usable "XTUserElection" entry.
std::optional<ElectionFilter> electionFilterOf(const tn::Value& rules);

// One election value normalised ("=1" -> "1"), or none.
std::optional<std::string> normalisedElection(const tn::Value& value);

// The election string of a candidate with `storedElection` (the stored
// annotation's "election", null when none) and `entitlements`.
std::string candidateElection(const tn::Value& storedElection, const tn::Value& entitlements);

// The annotation key a candidate's record is stored under: its
// replace-plugin entitlement when that is a string, else its identifier.
std::string annotationKeyOf(const std::string& identifier, const tn::Value& entitlements);

}  // namespace tnd
