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
#include <vector>

#include "platform/log/Level.h"
#include "platform/log/RateLimiter.h"

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

  // Sends `text` at `level` to the current sink, escaped (Escape.h) and
  // stamped with the time and the calling thread. Does not test enabled():
  // callers do (the macros). `site` identifies the call site (the macros
  // pass their format string literal): inside a client's context
  // (LogContext.h) the rate limiter may suppress the line (RateLimiter.h);
  // without a site the line is never suppressed.
  void write(Level level, std::string_view text, const void* site = nullptr) const;

  // write() in two steps, so that a line the rate limiter suppresses is
  // never formatted (the macros): admit() decides about a line of `site`
  // at `level` (writing the summaries owed), and writeAdmitted() sends a
  // line that was admitted.
  bool admit(Level level, const void* site) const;
  void writeAdmitted(Level level, std::string_view text) const;

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

// The process's one rate limiter, and the writer of the summaries it hands
// back (LogContext.cpp writes those a context owes when it ends).
RateLimiter& rateLimiter();
void writeSummaries(const std::vector<RateLimiter::Summary>& summaries);

}  // namespace detail

}  // namespace tn::log
