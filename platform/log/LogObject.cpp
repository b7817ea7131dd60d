#include "platform/log/LogObject.h"

#include <chrono>
#include <cstring>
#include <unistd.h>

#include "platform/log/Configuration.h"
#include "platform/log/Escape.h"
#include "platform/log/LogContext.h"
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

namespace {

// Every line passes here: escaped once, then handed to the sink.
void emit(std::string_view subsystem, std::string_view category, Level level, std::string_view text) {
  std::string escaped;
  if (needsEscaping(text)) {
    escaped = escapeText(text);
    text = escaped;
  }
  Record record{subsystem, category, level, text, std::chrono::system_clock::now(), ::gettid()};
  currentSink()->write(record);
}

}  // namespace

namespace detail {

RateLimiter& rateLimiter() {
  // Never destroyed: objects with static storage may still log at exit.
  static auto* limiter = new RateLimiter;
  return *limiter;
}

void writeSummaries(const std::vector<RateLimiter::Summary>& summaries) {
  for (const RateLimiter::Summary& summary : summaries)
    emit(summary.subsystem, summary.category, summary.level, RateLimiter::summaryText(summary.suppressed));
}

}  // namespace detail

void Log::write(Level level, std::string_view text, const void* site) const {
  if (admit(level, site)) writeAdmitted(level, text);
}

bool Log::admit(Level level, const void* site) const {
  const ContextId context = currentContext();
  if (context == 0 || site == nullptr) return true;
  const RateLimiter::Decision decision =
      detail::rateLimiter().admit(context, site, *this, level, RateLimiter::Clock::now());
  detail::writeSummaries(decision.summaries);
  return decision.write;
}

void Log::writeAdmitted(Level level, std::string_view text) const { emit(subsystem_, category_, level, text); }

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
