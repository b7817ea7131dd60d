#include "tools/tnctl/DisplayDate.h"

#include <cmath>

#include <fmt/format.h>

namespace tnctl {

std::string displayDate(tn::Date date) {
  if (!tn::hasISO8601Form(date)) return fmt::format("date({})", date.secondsSince1970);
  double whole = std::floor(date.secondsSince1970);
  auto micros = static_cast<int64_t>(std::llround((date.secondsSince1970 - whole) * 1e6));
  if (micros == 1000000) {  // rounded up into the next second
    whole += 1;
    micros = 0;
  }
  std::string text = tn::formatISO8601(tn::Date{whole});  // "...:26Z": whole seconds print no fraction
  if (micros == 0) return text;
  std::string fraction = fmt::format(".{:06}", micros);
  while (fraction.back() == '0') fraction.pop_back();
  text.insert(text.size() - 1, fraction);
  return text;
}

tn::Value withDisplayDates(const tn::Value& value) {
  if (std::optional<tn::Date> date = value.date()) return tn::Value(displayDate(*date));
  if (const tn::Array* elements = value.array()) {
    tn::Array shown;
    shown.reserve(elements->size());
    for (const tn::Value& element : *elements) shown.push_back(withDisplayDates(element));
    return tn::Value(std::move(shown));
  }
  if (const tn::Dictionary* entries = value.dictionary()) {
    tn::Dictionary shown;
    for (const auto& [key, entry] : *entries) shown.set(key, withDisplayDates(entry));
    return tn::Value(std::move(shown));
  }
  return value;
}

}  // namespace tnctl
