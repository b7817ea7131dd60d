#pragma once

// tn::Date: a point in time as seconds since 1970-01-01T00:00:00Z (a double,
// so sub-second precision survives every encoding), and its ISO 8601 text.

#include <compare>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace tn {

struct Date {
  double secondsSince1970 = 0;

  static Date now();

  // Equal when the seconds are equal; NaN dates equal each other so that a
  // decoded copy of a value always equals the original.
  friend bool operator==(const Date& a, const Date& b);
};

// "2026-11-22T20:53:00Z", with as many fractional digits as it takes for
// parseISO8601 to give back exactly the same double ("...:00.25Z"). Years
// outside 0000-9999 are written with a sign and at least four digits.
// Requires hasISO8601Form(date).
std::string formatISO8601(Date date);

// True for finite dates within about 300 million years of 1970: the dates
// that have a text form.
bool hasISO8601Form(Date date);

// The whole seconds since 1970 (rounded toward negative infinity), or none
// when the date is not finite or out of the range of int64_t. Converting a
// double outside that range to an integer is undefined, so every conversion
// of a stored or received date goes through this.
std::optional<int64_t> wholeSecondsSince1970(Date date);

// Parses what formatISO8601 writes: YYYY-MM-DDTHH:MM:SS[.fraction]Z, UTC only,
// plus the signed-year form. Returns none for anything else, and for times
// that do not exist: month 13, 2023-02-31, February 29 of a year that is not
// a leap year, hour 24 (even 24:00:00), minute 60, second 60 (no leap
// seconds). Every date read is written back as the same text.
std::optional<Date> parseISO8601(std::string_view text);

}  // namespace tn
