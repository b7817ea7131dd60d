// LevelRegistry (internal to platform/log): the current level settings and
// every live log object, so that new settings reach objects already made.

#pragma once

#include <mutex>
#include <vector>

#include "platform/log/LogSettings.h"

namespace tn::log {

class Log;

class LevelRegistry {
 public:
  // The process's registry. Never destroyed, and its construction touches
  // nothing else, so log objects may register from anywhere, even while
  // static objects are being made or destroyed.
  static LevelRegistry& the();

  // Adds `log` and gives it the current settings for its category.
  void attach(Log& log);
  // Removes `log`; it must be attached.
  void detach(Log& log);
  // Replaces the settings and applies them to every attached log.
  void apply(LogSettings settings);

 private:
  LevelRegistry() = default;

  std::mutex mutex_;
  LogSettings settings_;
  std::vector<Log*> logs_;
};

}  // namespace tn::log
