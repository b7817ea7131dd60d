#pragma once

// Which known word a misspelled one most likely meant, for lint's
// "did you mean" notes.

#include <optional>
#include <span>
#include <string>
#include <string_view>

namespace tnctl {

// The Levenshtein distance of the two words, letter case ignored.
size_t editDistance(std::string_view a, std::string_view b);

// The candidate nearest `word` when it is near enough to be a slip of the
// keyboard (at most 3 edits, and fewer than a third of the word); none
// otherwise. Ties go to the earlier candidate.
std::optional<std::string> likelyIntended(std::string_view word, std::span<const std::string_view> candidates);

}  // namespace tnctl
