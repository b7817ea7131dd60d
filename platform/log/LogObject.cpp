#include "platform/log/LogObject.h"

#include <chrono>
#include <cstring>
#include <unistd.h>

#include "platform/log/Configuration.h"
#include "platform/log/LevelRegistry.h"
#include "platform/log/Names.h"
#include "platform/log/Output.h"

namespace tn::log {

namespace {

constexpr std::size_t kMaxCategoryLength = 255;

unsigned withAlwaysOnLevels(unsigned mask) {
  return mask | (1u << static_cast<unsigned>(Level::Default)) |
         (1u << static_cast<unsigned>(Level::Error));
}

}  // namespace

Log::Log(std::string subsystem, std::string category)
    : subsystem_(std::move(subsystem)),
      category_(std::move(category)),
      enabledMask_(withAlwaysOnLevels(0)) {
  LevelRegistry::the().attach(*this);
}

Log::~Log() { LevelRegistry::the().detach(*this); }

void Log::write(Level level, std::string_view text) const {
  Record record{subsystem_, category_, level, text, std::chrono::system_clock::now(), ::gettid()};
  currentSink()->write(record);
}

void Log::setEnabledLevels(unsigned mask) noexcept {
  enabledMask_.store(withAlwaysOnLevels(mask), std::memory_order_relaxed);
}

std::shared_ptr<Log> createLog(std::string_view subsystem, const char* category) {
  if (category == nullptr) return nullptr;
  std::size_t length = std::strlen(category);
  if (length == 0 || length > kMaxCategoryLength) return nullptr;
  readEnvironmentOnce();
  return std::make_shared<Log>(std::string(subsystem), std::string(category, length));
}

Log& defaultLog() {
  readEnvironmentOnce();
  return detail::defaultLogWithoutConfiguration();
}

namespace detail {

Log& defaultLogWithoutConfiguration() {
  // Never destroyed: objects with static storage may log while the process
  // exits.
  static auto* log = new Log(std::string(), std::string(kDefaultCategory));
  return *log;
}

}  // namespace detail

}  // namespace tn::log
