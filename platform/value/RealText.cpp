#include "platform/value/RealText.h"

#include <charconv>
#include <cmath>

namespace tn::document {

void appendRealText(std::string& out, double d) {
  if (std::isnan(d)) {
    out += "nan";
  } else if (std::isinf(d)) {
    out += d < 0 ? "-inf" : "inf";
  } else {
    char buffer[32];
    // Without a format, to_chars writes the shortest text that round-trips.
    const auto result = std::to_chars(buffer, buffer + sizeof buffer, d);
    out.append(buffer, result.ptr);
  }
}

}  // namespace tn::document
