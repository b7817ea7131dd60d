#include "platform/log/LogSettings.h"

#include <algorithm>
#include <fmt/format.h>
#include <optional>

#include "platform/log/Names.h"

namespace tn::log {

namespace {

std::string_view trim(std::string_view text) {
  constexpr std::string_view kSpace = " \t\n\r";
  auto first = text.find_first_not_of(kSpace);
  if (first == std::string_view::npos) return {};
  auto last = text.find_last_not_of(kSpace);
  return text.substr(first, last - first + 1);
}

std::optional<Verbosity> verbosityNamed(std::string_view name) {
  auto level = parseLevel(name);
  if (!level) return std::nullopt;
  switch (*level) {
    case Level::Info: return Verbosity::Info;
    case Level::Debug: return Verbosity::Debug;
    case Level::Default:
    case Level::Error: return Verbosity::Quiet;
  }
  return std::nullopt;
}

bool isCategory(std::string_view name) {
  return std::find(kCategoryNames.begin(), kCategoryNames.end(), name) != kCategoryNames.end();
}

// Applies one item ("info" or "ops=debug") to `parsed`.
void parseItem(std::string_view item, std::string_view source, ParsedLogSettings& parsed) {
  auto equals = item.find('=');
  if (equals == std::string_view::npos) {
    if (auto verbosity = verbosityNamed(item)) {
      parsed.settings.everywhere = *verbosity;
    } else {
      parsed.problems.push_back(fmt::format("{}: unknown level \"{}\", ignored", source, item));
    }
    return;
  }
  std::string_view category = trim(item.substr(0, equals));
  std::string_view level = trim(item.substr(equals + 1));
  if (!isCategory(category)) {
    parsed.problems.push_back(
        fmt::format("{}: unknown category \"{}\" in \"{}\", ignored", source, category, item));
    return;
  }
  auto verbosity = verbosityNamed(level);
  if (!verbosity) {
    parsed.problems.push_back(
        fmt::format("{}: unknown level \"{}\" in \"{}\", ignored", source, level, item));
    return;
  }
  parsed.settings.categories.insert_or_assign(std::string(category), *verbosity);
}

}  // namespace

Verbosity LogSettings::verbosityFor(std::string_view category) const {
  auto found = categories.find(category);
  return found == categories.end() ? everywhere : found->second;
}

unsigned enabledLevelMask(Verbosity verbosity) noexcept {
  auto bit = [](Level level) { return 1u << static_cast<unsigned>(level); };
  unsigned mask = bit(Level::Default) | bit(Level::Error);
  if (verbosity >= Verbosity::Info) mask |= bit(Level::Info);
  if (verbosity >= Verbosity::Debug) mask |= bit(Level::Debug);
  return mask;
}

ParsedLogSettings parseLogSettings(std::string_view text, std::string_view source) {
  ParsedLogSettings parsed;
  while (!text.empty()) {
    auto comma = text.find(',');
    std::string_view item = trim(text.substr(0, comma));
    text = comma == std::string_view::npos ? std::string_view() : text.substr(comma + 1);
    if (!item.empty()) parseItem(item, source, parsed);
  }
  return parsed;
}

}  // namespace tn::log
