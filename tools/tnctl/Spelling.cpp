#include "tools/tnctl/Spelling.h"

#include <algorithm>
#include <cctype>
#include <vector>

namespace tnctl {
namespace {

constexpr size_t kMostEdits = 3;

char folded(char c) { return static_cast<char>(std::tolower(static_cast<unsigned char>(c))); }

}  // namespace

size_t editDistance(std::string_view a, std::string_view b) {
  // One row of the classic table at a time.
  std::vector<size_t> previous(b.size() + 1);
  std::vector<size_t> current(b.size() + 1);
  for (size_t j = 0; j <= b.size(); ++j) previous[j] = j;
  for (size_t i = 1; i <= a.size(); ++i) {
    current[0] = i;
    for (size_t j = 1; j <= b.size(); ++j) {
      const size_t substitution = previous[j - 1] + (folded(a[i - 1]) == folded(b[j - 1]) ? 0 : 1);
      current[j] = std::min({previous[j] + 1, current[j - 1] + 1, substitution});
    }
    std::swap(previous, current);
  }
  return previous[b.size()];
}

std::optional<std::string> likelyIntended(std::string_view word, std::span<const std::string_view> candidates) {
  std::optional<std::string> best;
  size_t bestDistance = std::min(kMostEdits, (word.size() + 2) / 3);
  bool found = false;
  for (std::string_view candidate : candidates) {
    const size_t distance = editDistance(word, candidate);
    if (distance < bestDistance || (!found && distance <= bestDistance)) {
      best = std::string(candidate);
      bestDistance = distance;
      found = true;
    }
  }
  return best;
}

}  // namespace tnctl
