// Log: a log object, the thing messages are logged on. Each has a subsystem
// and a category and knows which levels are enabled for it.
//
// The daemon uses the process-wide objects of Categories.h and the default
// log below through the TN_LOG_* macros (LogMacros.h), which test enabled()
// before evaluating or formatting any argument.

#pragma once

#include <atomic>
#include <memory>
#include <string>
#include <string_view>

#include "platform/log/Level.h"

namespace tn::log {

class Log {
 public:
  // Makes a log object and registers it with the level settings, so that
  // configure() reaches it; it starts with the current settings for its
  // category. Does not read TENON_LOG: createLog() does.
  Log(std::string subsystem, std::string category);
  ~Log();  // unregisters
  Log(const Log&) = delete;
  Log& operator=(const Log&) = delete;

  const std::string& subsystem() const { return subsystem_; }
  const std::string& category() const { return category_; }

  // True when messages at `level` are written. Always true for default and
  // error. One relaxed atomic load: cheap enough to test before every call.
  bool enabled(Level level) const noexcept {
    return (enabledMask_.load(std::memory_order_relaxed) & (1u << static_cast<unsigned>(level))) !=
           0;
  }

  // Sends `text` at `level` to the current sink, stamped with the time and
  // the calling thread. Does not test enabled(): callers do (the macros).
  void write(Level level, std::string_view text) const;

  // Sets which levels are enabled (bit 1 << level). Used by the level
  // settings; default and error stay on whatever `mask` says.
  void setEnabledLevels(unsigned mask) noexcept;

 private:
  std::string subsystem_;
  std::string category_;
  std::atomic<unsigned> enabledMask_;
};

// The platform's maker of log objects: returns a new log object of
// `subsystem` and `category`, with TENON_LOG read first if nothing has read
// it yet. Returns null when `category` is null or empty, or longer than 255
// bytes.
std::shared_ptr<Log> createLog(std::string_view subsystem, const char* category);

// The default log: no subsystem, category "default". Made on first use,
// never destroyed. Reads TENON_LOG if nothing has read it yet.
Log& defaultLog();

namespace detail {

// The default log object, for the code that reads TENON_LOG: unlike
// defaultLog() it does not read TENON_LOG itself, since that code reports
// problems on this very log.
Log& defaultLogWithoutConfiguration();

}  // namespace detail

}  // namespace tn::log
