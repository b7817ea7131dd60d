#include "libtenon/model/VersionComparison.h"

namespace tn {
namespace {

bool isDigit(char c) { return c >= '0' && c <= '9'; }

int sign(int v) { return (v > 0) - (v < 0); }

// Compares the digit runs starting at a[i] and b[j] as numbers of any length
// (no overflow: leading zeros are skipped, then length, then digits decide)
// and advances both indices past their runs.
int compareNumberRuns(std::string_view a, size_t& i, std::string_view b, size_t& j) {
  while (i < a.size() && a[i] == '0' && i + 1 < a.size() && isDigit(a[i + 1])) ++i;
  while (j < b.size() && b[j] == '0' && j + 1 < b.size() && isDigit(b[j + 1])) ++j;
  size_t ai = i, bj = j;
  while (ai < a.size() && isDigit(a[ai])) ++ai;
  while (bj < b.size() && isDigit(b[bj])) ++bj;
  const size_t aLength = ai - i, bLength = bj - j;
  int order = 0;
  if (aLength != bLength) {
    order = aLength < bLength ? -1 : 1;
  } else {
    order = sign(a.substr(i, aLength).compare(b.substr(j, bLength)));
  }
  i = ai;
  j = bj;
  return order;
}

}  // namespace

int compareVersionString(std::string_view receiver, std::string_view other) {
  size_t i = 0, j = 0;
  while (i < receiver.size() && j < other.size()) {
    if (isDigit(receiver[i]) && isDigit(other[j])) {
      if (int order = compareNumberRuns(receiver, i, other, j)) return order;
      continue;
    }
    const auto a = static_cast<unsigned char>(receiver[i]);
    const auto b = static_cast<unsigned char>(other[j]);
    if (a != b) return a < b ? -1 : 1;
    ++i;
    ++j;
  }
  const bool receiverLeft = i < receiver.size(), otherLeft = j < other.size();
  if (receiverLeft == otherLeft) return 0;
  return receiverLeft ? 1 : -1;
}

}  // namespace tn
