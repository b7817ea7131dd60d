#include "platform/value/Date.h"

#include <charconv>
#include <chrono>
#include <cmath>
#include <cstdlib>
#include <cstdint>

#include <fmt/format.h>

namespace tn {
namespace {

// Days since 1970-01-01 of a proleptic Gregorian date, and back. These are
// the standard era-based conversions; they work for every year.
int64_t daysFromCivil(int64_t y, unsigned m, unsigned d) {
  y -= m <= 2;
  const int64_t era = (y >= 0 ? y : y - 399) / 400;
  const unsigned yoe = static_cast<unsigned>(y - era * 400);
  const unsigned doy = (153 * (m + (m > 2 ? -3 : 9)) + 2) / 5 + d - 1;
  const unsigned doe = yoe * 365 + yoe / 4 - yoe / 100 + doy;
  return era * 146097 + static_cast<int64_t>(doe) - 719468;
}

struct Civil {
  int64_t year;
  unsigned month, day;
};

Civil civilFromDays(int64_t z) {
  z += 719468;
  const int64_t era = (z >= 0 ? z : z - 146096) / 146097;
  const unsigned doe = static_cast<unsigned>(z - era * 146097);
  const unsigned yoe = (doe - doe / 1460 + doe / 36524 - doe / 146096) / 365;
  const int64_t y = static_cast<int64_t>(yoe) + era * 400;
  const unsigned doy = doe - (365 * yoe + yoe / 4 - yoe / 100);
  const unsigned mp = (5 * doy + 2) / 153;
  const unsigned d = doy - (153 * mp + 2) / 5 + 1;
  const unsigned m = mp < 10 ? mp + 3 : mp - 9;
  return {y + (m <= 2), m, d};
}

bool readDigits(std::string_view& s, size_t count, int64_t& out) {
  if (s.size() < count) return false;
  out = 0;
  for (size_t i = 0; i < count; ++i) {
    if (s[i] < '0' || s[i] > '9') return false;
    out = out * 10 + (s[i] - '0');
  }
  s.remove_prefix(count);
  return true;
}

bool isLeapYear(int64_t year) { return year % 4 == 0 && (year % 100 != 0 || year % 400 == 0); }

int64_t daysInMonth(int64_t year, int64_t month) {
  static constexpr int64_t kDays[] = {31, 28, 31, 30, 31, 30, 31, 31, 30, 31, 30, 31};
  return month == 2 && isLeapYear(year) ? 29 : kDays[month - 1];
}

// Only times the writer can produce are read, so that reading and writing
// back never changes a date: months 1-12, days that exist in that month of
// that year, hours 0-23 (no 24:00:00), minutes and seconds 0-59 (dates count
// seconds without leap seconds, so 23:59:60 would read as the next day).
bool isRealTime(int64_t year, int64_t month, int64_t day, int64_t hour, int64_t minute, int64_t second) {
  if (month < 1 || month > 12 || day < 1 || day > daysInMonth(year, month)) return false;
  return hour <= 23 && minute <= 59 && second <= 59;
}

bool expect(std::string_view& s, char c) {
  if (s.empty() || s.front() != c) return false;
  s.remove_prefix(1);
  return true;
}

}  // namespace

Date Date::now() {
  using namespace std::chrono;
  return Date{duration<double>(system_clock::now().time_since_epoch()).count()};
}

bool operator==(const Date& a, const Date& b) {
  if (std::isnan(a.secondsSince1970) && std::isnan(b.secondsSince1970)) return true;
  return a.secondsSince1970 == b.secondsSince1970;
}

bool hasISO8601Form(Date date) {
  const double t = date.secondsSince1970;
  if (!std::isfinite(t) || std::fabs(t) > 1e16) return false;
  // The text is whole seconds plus a fraction, read back as their sum. A
  // tiny negative t has none that adds up to it: its fraction t - floor(t)
  // rounds to 1.
  const double whole = std::floor(t);
  const double fraction = t - whole;
  return fraction < 1.0 && whole + fraction == t;
}

std::optional<int64_t> wholeSecondsSince1970(Date date) {
  const double whole = std::floor(date.secondsSince1970);
  // -2^63 is exact as a double; 2^63 is the first value past the range.
  constexpr double kLimit = 9223372036854775808.0;
  if (!std::isfinite(whole) || whole < -kLimit || whole >= kLimit) return std::nullopt;
  return static_cast<int64_t>(whole);
}

std::string formatISO8601(Date date) {
  const double t = date.secondsSince1970;
  const double whole = std::floor(t);
  // t - floor(t) is exact for every double, and whole + fraction rounds back
  // to t, so printing the fraction's shortest form is lossless.
  const double fraction = t - whole;
  const int64_t secs = static_cast<int64_t>(whole);
  int64_t days = secs / 86400;
  int64_t rem = secs % 86400;
  if (rem < 0) {
    rem += 86400;
    days -= 1;
  }
  const Civil c = civilFromDays(days);
  std::string year = (c.year >= 0 && c.year <= 9999) ? fmt::format("{:04}", c.year)
                                                      : fmt::format("{:+05}", c.year);
  std::string out = fmt::format("{}-{:02}-{:02}T{:02}:{:02}:{:02}", year, c.month, c.day,
                                rem / 3600, rem / 60 % 60, rem % 60);
  if (fraction != 0) {
    // The shortest fixed form of a fraction takes up to "0." + 323 zeros +
    // 17 digits (a subnormal one).
    char buf[400];
    auto r = std::to_chars(buf, buf + sizeof buf, fraction, std::chars_format::fixed);
    if (r.ec != std::errc()) std::abort();  // cannot happen with this buffer
    std::string_view digits(buf, static_cast<size_t>(r.ptr - buf));  // "0.25"
    out.append(digits.substr(1));
  }
  out.push_back('Z');
  return out;
}

std::optional<Date> parseISO8601(std::string_view s) {
  bool negativeYear = false;
  bool signedYear = false;
  if (!s.empty() && (s.front() == '+' || s.front() == '-')) {
    negativeYear = s.front() == '-';
    signedYear = true;
    s.remove_prefix(1);
  }
  size_t yearDigits = 0;
  while (yearDigits < s.size() && s[yearDigits] >= '0' && s[yearDigits] <= '9') ++yearDigits;
  if (yearDigits < 4 || yearDigits > 9 || (!signedYear && yearDigits != 4)) return std::nullopt;
  int64_t year, month, day, hour, minute, second;
  if (!readDigits(s, yearDigits, year)) return std::nullopt;
  if (negativeYear) year = -year;
  if (!expect(s, '-') || !readDigits(s, 2, month) || !expect(s, '-') || !readDigits(s, 2, day) ||
      !expect(s, 'T') || !readDigits(s, 2, hour) || !expect(s, ':') || !readDigits(s, 2, minute) ||
      !expect(s, ':') || !readDigits(s, 2, second))
    return std::nullopt;
  if (!isRealTime(year, month, day, hour, minute, second)) return std::nullopt;
  double fraction = 0;
  if (!s.empty() && s.front() == '.') {
    size_t end = 1;
    while (end < s.size() && s[end] >= '0' && s[end] <= '9') ++end;
    if (end == 1) return std::nullopt;
    std::string digits = "0";
    digits.append(s.substr(0, end));
    auto r = std::from_chars(digits.data(), digits.data() + digits.size(), fraction);
    if (r.ec != std::errc() || r.ptr != digits.data() + digits.size()) return std::nullopt;
    s.remove_prefix(end);
  }
  if (s != "Z") return std::nullopt;
  const int64_t days = daysFromCivil(year, static_cast<unsigned>(month), static_cast<unsigned>(day));
  const double whole = static_cast<double>(days * 86400 + hour * 3600 + minute * 60 + second);
  return Date{whole + fraction};
}

}  // namespace tn
