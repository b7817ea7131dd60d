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

// Fractions of a second as small as a double gets have their long text, and
// read back exactly; a tiny negative instant has no text that adds up to it.
TEST(DateText, TinyFractionsRoundTripOrHaveNoForm) {
  for (const double t : {5e-324, 1e-309, 2.2250738585072014e-308, 1e-300, 1.0 + 2.220446049250313e-16}) {
    ASSERT_TRUE(hasISO8601Form(Date{t})) << t;
    const auto back = parseISO8601(formatISO8601(Date{t}));
    ASSERT_TRUE(back) << formatISO8601(Date{t});
    EXPECT_EQ(back->secondsSince1970, t) << formatISO8601(Date{t});
  }
  EXPECT_EQ(formatISO8601(Date{5e-324}).size(), std::string("1970-01-01T00:00:00.").size() + 323 + 1 + 1);
  EXPECT_FALSE(hasISO8601Form(Date{-5e-324}));
  EXPECT_FALSE(hasISO8601Form(Date{-1e-300}));
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

// Times that do not exist are refused rather than rolled over into another
// date (which would change the text on write-back).
TEST(DateText, ImpossibleTimesAreRefusedAndEveryRealDayIsRead) {
  for (const char* bad :
       {"2023-02-31T00:00:00Z", "2023-02-29T00:00:00Z", "1900-02-29T00:00:00Z", "2023-04-31T00:00:00Z",
        "2023-00-10T00:00:00Z", "2023-01-00T00:00:00Z", "2023-01-32T00:00:00Z", "2023-12-31T24:00:00Z",
        "2023-12-31T23:60:00Z", "2016-12-31T23:59:60Z", "+2023-02-30T00:00:00Z", "-0001-02-29T00:00:00Z"})
    EXPECT_FALSE(parseISO8601(bad)) << bad;
  for (const char* good : {"2024-02-29T00:00:00Z", "2000-02-29T23:59:59Z", "2023-04-30T12:00:00Z",
                           "-0004-02-29T00:00:00Z", "2023-12-31T23:59:59.5Z"}) {
    const std::optional<Date> date = parseISO8601(good);
    ASSERT_TRUE(date) << good;
    EXPECT_EQ(formatISO8601(*date), good) << "written back unchanged";
  }
  // Every day of a leap and a common year reads and writes back unchanged.
  for (const double start : {1704067200.0, 1672531200.0}) {  // 2024-01-01, 2023-01-01
    for (int day = 0; day < 366; ++day) {
      const std::string text = formatISO8601(Date{start + day * 86400.0});
      const std::optional<Date> back = parseISO8601(text);
      ASSERT_TRUE(back) << text;
      EXPECT_EQ(formatISO8601(*back), text);
    }
  }
}

TEST(DateText, WholeSecondsAreConvertedOnlyWhenInRange) {
  EXPECT_EQ(wholeSecondsSince1970(Date{1.75}), 1);
  EXPECT_EQ(wholeSecondsSince1970(Date{-1.25}), -2);
  EXPECT_EQ(wholeSecondsSince1970(Date{-9223372036854775808.0}), INT64_MIN);
  for (const double bad : {double(NAN), double(INFINITY), -double(INFINITY), 9223372036854775808.0, 1e300, -1e19})
    EXPECT_FALSE(wholeSecondsSince1970(Date{bad})) << bad;
}

}  // namespace
}  // namespace tn
