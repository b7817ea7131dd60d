#include "platform/log/LevelRegistry.h"

#include <algorithm>

#include "platform/log/LogObject.h"

namespace tn::log {

LevelRegistry& LevelRegistry::the() {
  static auto* registry = new LevelRegistry;
  return *registry;
}

void LevelRegistry::attach(Log& log) {
  std::lock_guard lock(mutex_);
  log.setEnabledLevels(enabledLevelMask(settings_.verbosityFor(log.category())));
  logs_.push_back(&log);
}

void LevelRegistry::detach(Log& log) {
  std::lock_guard lock(mutex_);
  logs_.erase(std::remove(logs_.begin(), logs_.end(), &log), logs_.end());
}

void LevelRegistry::apply(LogSettings settings) {
  std::lock_guard lock(mutex_);
  settings_ = std::move(settings);
  for (Log* log : logs_) {
    log->setEnabledLevels(enabledLevelMask(settings_.verbosityFor(log->category())));
  }
}

}  // namespace tn::log
