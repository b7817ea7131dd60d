#pragma once

// Random structured values for round-trip tests: every kind, nested, with the
// edge numbers (2^63, -1, NaN, infinities, -0.0) and awkward strings (control
// characters, NUL, characters that need escaping, multi-byte UTF-8) that
// encoders get wrong. Deterministic for a given seed.

#include <cmath>
#include <cstdint>
#include <limits>
#include <random>
#include <string>

#include "platform/value/Value.h"

namespace tn::test {

class ValueGenerator {
 public:
  explicit ValueGenerator(uint32_t seed) : rng_(seed) {}

  // A value of any kind, containers nested at most maxDepth deep.
  Value any(int maxDepth = 4) {
    const int kinds = maxDepth > 0 ? 11 : 9;
    switch (pick(kinds)) {
      case 0: return Value();
      case 1: return Value(pick(2) == 1);
      case 2: return Value(signedInteger());
      case 3: return Value(unsignedInteger());
      case 4: return Value(real());
      case 5: return Value(text());
      case 6: return Value(bytes());
      case 7: return Value(date());
      case 8: return Value(UUID::random());
      case 9: return array(maxDepth - 1);
      default: return dictionary(maxDepth - 1);
    }
  }

  Value array(int maxDepth) {
    Array a;
    for (int n = pick(6); n > 0; --n) a.push_back(any(maxDepth));
    return Value(std::move(a));
  }

  Value dictionary(int maxDepth) {
    Dictionary d;
    for (int n = pick(8); n > 0; --n) d.set(text(), any(maxDepth));
    return Value(std::move(d));
  }

  int64_t signedInteger() {
    static constexpr int64_t kEdges[] = {0, 1, -1, 23, 24, -24, -25, 255, 256, 65535, 65536,
                                         -4294967296LL, 4294967295LL,
                                         std::numeric_limits<int64_t>::max(),
                                         std::numeric_limits<int64_t>::min()};
    if (pick(2) == 0) return kEdges[pick(std::size(kEdges))];
    return static_cast<int64_t>(rng_());
  }

  uint64_t unsignedInteger() {
    static constexpr uint64_t kEdges[] = {0, 1, 23, 24, 255, 256, 65535, 65536, 4294967296ULL,
                                          9223372036854775807ULL, 9223372036854775808ULL,
                                          std::numeric_limits<uint64_t>::max()};
    if (pick(2) == 0) return kEdges[pick(std::size(kEdges))];
    return rng_();
  }

  double real() {
    static const double kEdges[] = {0.0, -0.0, 1.0, -1.0, 0.1, 1e300, -1e-300, 5e-324,
                                    9223372036854775808.0,
                                    std::numeric_limits<double>::quiet_NaN(),
                                    std::numeric_limits<double>::infinity(),
                                    -std::numeric_limits<double>::infinity(),
                                    std::numeric_limits<double>::max()};
    if (pick(2) == 0) return kEdges[pick(std::size(kEdges))];
    std::uniform_real_distribution<double> d(-1e9, 1e9);
    return d(rng_);
  }

  std::string text() {
    static const char* const kPieces[] = {"a", "Z", "key", " ", "<", ">", "&", "\"", "'", "\\",
                                          "\n", "\r", "\t", "\x01", "\x1f", std::string_view("\0", 1).data(),
                                          "\xC3\xA9", "\xE2\x82\xAC", "\xF0\x9F\x98\x80", "]]>", "&amp;",
                                          "com.ostrel.tenon", "/", "%20"};
    std::string s;
    for (int n = pick(6); n > 0; --n) {
      const size_t i = pick(std::size(kPieces));
      // The NUL piece is one byte long; strlen would see none.
      if (kPieces[i][0] == '\0')
        s.push_back('\0');
      else
        s += kPieces[i];
    }
    return s;
  }

  Bytes bytes() {
    Bytes b(pick(40));
    for (auto& x : b) x = static_cast<uint8_t>(rng_());
    return b;
  }

  Date date() {
    static const double kEdges[] = {0.0, -1.5, 1e9, 1795902780.25, -62135596800.0, 253402300799.999};
    if (pick(2) == 0) return Date{kEdges[pick(std::size(kEdges))]};
    std::uniform_real_distribution<double> d(-1e10, 1e10);
    return Date{d(rng_)};
  }

 private:
  int pick(size_t n) { return static_cast<int>(rng_() % n); }

  std::mt19937_64 rng_;
};

}  // namespace tn::test
