#include "platform/value/Date.h"

#include <gtest/gtest.h>

#include <cmath>
#include <random>

namespace tn {
namespace {

TEST(DateText, KnownInstantsHaveTheirIsoText) {
  EXPECT_EQ(formatISO8601(Date{0}), "1970-01-01T00:00:00Z");
  EXPECT_EQ(formatISO8601(Date{1795902780.25}), "2026-11-28T21:53:00.25Z");
  EXPECT_EQ(formatISO8601(Date{-1.5}), "1969-12-31T23:59:58.5Z");
  EXPECT_EQ(formatISO8601(Date{951782400}), "2000-02-29T00:00:00Z");
  EXPECT_EQ(formatISO8601(Date{-62135596800.0}), "0001-01-01T00:00:00Z");
  EXPECT_EQ(formatISO8601(Date{253402300800.0}), "+10000-01-01T00:00:00Z");
}

TEST(DateText, EveryDoubleInRangeRoundTripsExactly) {
  std::mt19937_64 rng(3);
  std::uniform_real_distribution<double> dist(-1e12, 1e12);
  for (int i = 0; i < 20000; ++i) {
    const Date d{i % 2 ? dist(rng) : std::floor(dist(rng))};
    auto back = parseISO8601(formatISO8601(d));
    ASSERT_TRUE(back) << formatISO8601(d);
    EXPECT_EQ(back->secondsSince1970, d.secondsSince1970) << formatISO8601(d);
  }
}

TEST(DateText, ParseRefusesAnythingButUtcIsoText) {
  for (const char* bad : {"", "1970-01-01", "1970-01-01T00:00:00", "1970-01-01T00:00:00+01:00",
                          "1970-13-01T00:00:00Z", "1970-01-01T24:00:00Z", "1970-01-01T00:00:00.Z",
                          "70-01-01T00:00:00Z", "1970-01-01 00:00:00Z", "1970-01-01T00:00:00ZZ"})
    EXPECT_FALSE(parseISO8601(bad)) << bad;
  EXPECT_FALSE(hasISO8601Form(Date{NAN}));
  EXPECT_FALSE(hasISO8601Form(Date{INFINITY}));
  EXPECT_FALSE(hasISO8601Form(Date{1e300}));
}

}  // namespace
}  // namespace tn
