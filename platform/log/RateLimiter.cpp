#include "platform/log/RateLimiter.h"

#include <algorithm>
#include <tuple>

#include <fmt/format.h>

#include "platform/log/LogObject.h"

namespace tn::log {

std::string RateLimiter::summaryText(uint64_t suppressed) {
  return fmt::format("\u2026 {} similar lines suppressed", suppressed);
}

void RateLimiter::collect(Context& context, std::vector<Summary>& owed) {
  for (auto& [site, entry] : context.entries) {
    if (entry.suppressed == 0) continue;
    Summary summary = entry.owner;
    summary.suppressed = entry.suppressed;
    owed.push_back(std::move(summary));
    entry.suppressed = 0;
  }
}

RateLimiter::Context& RateLimiter::contextFor(uint64_t context, std::vector<Summary>& owed) {
  if (auto found = contexts_.find(context); found != contexts_.end()) {
    recent_.splice(recent_.begin(), recent_, found->second.recent);
    return found->second;
  }
  if (contexts_.size() >= kMaxContexts) {
    const uint64_t oldest = recent_.back();
    collect(contexts_.at(oldest), owed);
    contexts_.erase(oldest);
    recent_.pop_back();
  }
  recent_.push_front(context);
  Context& made = contexts_[context];
  made.recent = recent_.begin();
  return made;
}

RateLimiter::Decision RateLimiter::admit(uint64_t context, const void* site, const Log& log, Level level,
                                         Clock::time_point now) {
  Decision decision;
  if (context == 0 || site == nullptr) return decision;
  const std::lock_guard lock(mutex_);
  Context& state = contextFor(context, decision.summaries);
  auto found = state.entries.find(site);
  if (found == state.entries.end()) {
    // A full context sends further sites to its overflow bucket (key null).
    const void* key = state.entries.size() + 1 < kMaxSitesPerContext ? site : nullptr;
    bool inserted = false;
    std::tie(found, inserted) = state.entries.try_emplace(key);
    if (inserted) {
      found->second.refilled = now;
      found->second.owner = Summary{log.subsystem(), log.category(), level, 0};
    }
  }
  Entry& entry = found->second;
  const double elapsed = std::chrono::duration<double>(now - entry.refilled).count();
  entry.tokens = std::min(kBurst, entry.tokens + std::max(0.0, elapsed) * kRatePerSecond);
  entry.refilled = now;
  if (entry.tokens < 1) {
    ++entry.suppressed;
    decision.write = false;
    return decision;
  }
  entry.tokens -= 1;
  if (entry.suppressed != 0) {
    Summary summary = entry.owner;
    summary.suppressed = entry.suppressed;
    decision.summaries.push_back(std::move(summary));
    entry.suppressed = 0;
  }
  return decision;
}

std::vector<RateLimiter::Summary> RateLimiter::endContext(uint64_t context) {
  std::vector<Summary> owed;
  const std::lock_guard lock(mutex_);
  auto found = contexts_.find(context);
  if (found == contexts_.end()) return owed;
  collect(found->second, owed);
  recent_.erase(found->second.recent);
  contexts_.erase(found);
  return owed;
}

std::size_t RateLimiter::contextCount() const {
  const std::lock_guard lock(mutex_);
  return contexts_.size();
}

std::size_t RateLimiter::entryCount(uint64_t context) const {
  const std::lock_guard lock(mutex_);
  const auto found = contexts_.find(context);
  return found == contexts_.end() ? 0 : found->second.entries.size();
}

}  // namespace tn::log
