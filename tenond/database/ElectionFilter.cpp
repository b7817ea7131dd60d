#include "tenond/database/ElectionFilter.h"

#include <cctype>
#include <cmath>
#include <cstdint>

#include "tenond/database/TNDatabase.h"
#include "tenond/plugin/TNDPlugIn.h"

namespace tnd {

std::optional<std::string> normalisedElection(const tn::Value& value) {
  const std::string* text = value.string();
  if (text == nullptr || text->empty()) return std::nullopt;
  if (text->front() == '=') return text->substr(1);
  if (std::isalnum(static_cast<unsigned char>(text->front())) != 0) return *text;
  return std::nullopt;
}

std::optional<ElectionFilter> electionFilterOf(const tn::Value& rules) {
  const tn::Value entry = rules["XTUserElection"];
  if (entry.isString()) {
    std::optional<std::string> one = normalisedElection(entry);
    if (!one) return std::nullopt;
    return ElectionFilter{std::move(*one)};
  }
  const tn::Array* list = entry.array();
  if (list == nullptr) return std::nullopt;
  ElectionFilter filter;
  for (const tn::Value& element : *list) {
    std::optional<std::string> normalised = normalisedElection(element);
    if (!normalised) return std::nullopt;  // one element not understood: no filter at all
    filter.push_back(std::move(*normalised));
  }
  return filter;
}

namespace {

// The low 8 bits of an election number, as an unsigned byte. A number that
// is not integral, or out of range, is taken by its value truncated toward
// zero when that fits a signed 64-bit integer, else as 0: elections are
// small numbers, and no conversion here may be undefined.
unsigned electionByte(const tn::Value& election) {
  int64_t whole = 0;
  if (const std::optional<int64_t> integer = election.int64()) {
    whole = *integer;
  } else if (const std::optional<uint64_t> unsignedInteger = election.uint64()) {
    whole = static_cast<int64_t>(*unsignedInteger);  // modulo 2^64: the low bits are what count
  } else if (const std::optional<double> number = election.numberAsDouble();
             number && std::isfinite(*number) && std::fabs(*number) < 9.2e18) {
    whole = static_cast<int64_t>(*number);
  }
  return static_cast<unsigned>(static_cast<uint64_t>(whole) & 0xffu);
}

}  // namespace

std::string candidateElection(const tn::Value& storedElection, const tn::Value& entitlements) {
  if (!storedElection.isNull() && storedElection.numberAsDouble()) {
    return std::to_string(electionByte(storedElection));
  }
  const tn::Value autoElect = entitlements[TNDatabase::kAutoElectEntitlement];
  const bool elected = autoElect.numberAsDouble() && autoElect == tn::Value(true);
  return elected ? "1" : "0";
}

std::string annotationKeyOf(const std::string& identifier, const tn::Value& entitlements) {
  const tn::Value replaced = entitlements[TNDPlugIn::kReplacePlugInEntitlement];
  if (const std::string* key = replaced.string()) return *key;
  return identifier;
}

}  // namespace tnd
