#include "platform/log/Configuration.h"

#include <cstdlib>
#include <mutex>

#include "platform/log/LevelRegistry.h"
#include "platform/log/LogMacros.h"
#include "platform/log/LogSettings.h"

namespace tn::log {

namespace {

// Applies `spec` and reports what was wrong with it on the default log.
std::vector<std::string> applySpec(std::string_view spec, std::string_view source) {
  ParsedLogSettings parsed = parseLogSettings(spec, source);
  LevelRegistry::the().apply(std::move(parsed.settings));
  for (const std::string& problem : parsed.problems) {
    TN_LOG_ERROR(detail::defaultLogWithoutConfiguration(), "{}", problem);
  }
  return std::move(parsed.problems);
}

}  // namespace

void readEnvironmentOnce() {
  static std::once_flag once;
  std::call_once(once, [] {
    const char* spec = std::getenv("TENON_LOG");
    applySpec(spec == nullptr ? std::string_view() : std::string_view(spec), "TENON_LOG");
  });
}

std::vector<std::string> configure(std::string_view spec) {
  readEnvironmentOnce();
  return applySpec(spec, "log configuration");
}

}  // namespace tn::log
