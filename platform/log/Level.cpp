#include "platform/log/Level.h"

#include <array>

namespace tn::log {

namespace {

constexpr std::array<std::string_view, 4> kLevelNames = {"default", "info", "debug", "error"};

}  // namespace

std::string_view levelName(Level level) noexcept {
  return kLevelNames[static_cast<unsigned>(level)];
}

std::optional<Level> parseLevel(std::string_view name) noexcept {
  for (unsigned i = 0; i < kLevelNames.size(); ++i) {
    if (kLevelNames[i] == name) return static_cast<Level>(i);
  }
  return std::nullopt;
}

}  // namespace tn::log
