// How tnctl writes dates and guesses the key an author meant.

#include <gtest/gtest.h>

#include <array>
#include <string_view>

#include "tools/tnctl/DisplayDate.h"
#include "tools/tnctl/Spelling.h"

namespace tnctl {
namespace {

TEST(DisplayDate, AtMostMicrosecondsAndNoTrailingZeros) {
  EXPECT_EQ(displayDate(tn::Date{1700000000}), "2023-11-14T22:13:20Z");
  EXPECT_EQ(displayDate(tn::Date{1700000000.5}), "2023-11-14T22:13:20.5Z");
  // An exact binary fraction would print seventeen digits.
  EXPECT_EQ(displayDate(tn::Date{1700000000.1234567}), "2023-11-14T22:13:20.123457Z");
  // Rounding up into the next second, and the next day.
  EXPECT_EQ(displayDate(tn::Date{1700000000.9999996}), "2023-11-14T22:13:21Z");
  EXPECT_EQ(displayDate(tn::Date{86399.9999999}), "1970-01-02T00:00:00Z");
  // Before 1970 the fraction still counts forward from the whole second.
  EXPECT_EQ(displayDate(tn::Date{-0.25}), "1969-12-31T23:59:59.75Z");
}

TEST(DisplayDate, DatesInsideValuesBecomeTheirText) {
  const tn::Value shown = withDisplayDates(
      tn::Value(tn::Dictionary{{"when", tn::Date{0.5}}, {"list", tn::Array{tn::Value(tn::Date{1}), tn::Value(3)}}}));
  EXPECT_EQ(shown["when"], tn::Value("1970-01-01T00:00:00.5Z"));
  EXPECT_EQ(shown["list"], tn::Value(tn::Array{tn::Value("1970-01-01T00:00:01Z"), tn::Value(3)}));
}

TEST(Spelling, SuggestsTheNearestKnownKeyOnlyWhenItIsNear) {
  constexpr std::array<std::string_view, 3> kKeys{"XTExtensionProtocol", "XTExtensionAttributes", "Shared"};
  EXPECT_EQ(likelyIntended("XTExtensionProtocl", kKeys), "XTExtensionProtocol");
  EXPECT_EQ(likelyIntended("xtextensionattributes", kKeys), "XTExtensionAttributes");  // case is a slip too
  EXPECT_EQ(likelyIntended("Shard", kKeys), "Shared");
  EXPECT_EQ(likelyIntended("Colour", kKeys), std::nullopt);
  EXPECT_EQ(likelyIntended("XTExtensionVersion", kKeys), std::nullopt);  // a different key, not a slip
  EXPECT_EQ(editDistance("kitten", "sitting"), 3u);
}

}  // namespace
}  // namespace tnctl
