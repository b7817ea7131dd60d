#pragma once

// Dates as tnctl shows them: ISO 8601 in UTC with at most microseconds
// ("2026-11-23T21:33:26.5Z", "2026-11-23T21:33:26.123457Z"), never the
// dozen fractional digits of an exact binary fraction.

#include <string>

#include "platform/value/Date.h"
#include "platform/value/Value.h"

namespace tnctl {

// Rounded to the nearest microsecond; trailing zeros of the fraction (and a
// fraction of zero) are left out. A date without an ISO 8601 form reads
// "date(<seconds since 1970>)".
std::string displayDate(tn::Date date);

// `value` with every date in it, at any depth, replaced by its displayDate
// string: what tnctl prints, readable or as JSON.
tn::Value withDisplayDates(const tn::Value& value);

}  // namespace tnctl
