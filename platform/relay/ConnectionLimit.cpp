#include "platform/relay/ConnectionLimit.h"

#include <unistd.h>

#include "platform/relay/KeepAlive.h"

namespace relay::detail {
namespace {

constexpr std::chrono::minutes kRefusalLogInterval{1};
// Beyond this many remembered uids, entries older than the interval go.
constexpr std::size_t kRememberedRefusals = 4096;

}  // namespace

bool ConnectionLimit::isPrivileged(uid_t uid) { return uid == 0 || uid == ::geteuid(); }

std::shared_ptr<void> ConnectionLimit::acquire(uid_t uid, Refusal* why) {
  {
    const std::lock_guard lock(mutex_);
    const std::size_t reserve = isPrivileged(uid) ? 0 : limits_.privilegedReserve;
    const std::size_t totalAllowed = limits_.total > reserve ? limits_.total - reserve : 0;
    std::size_t& live = live_[uid];
    Refusal refusal = Refusal::None;
    if (live >= limits_.perUser) {
      refusal = Refusal::PerUser;
    } else if (total_ >= totalAllowed) {
      refusal = Refusal::Total;
    }
    if (refusal != Refusal::None) {
      if (live == 0) live_.erase(uid);
      if (why != nullptr) *why = refusal;
      return nullptr;
    }
    ++live;
    ++total_;
  }
  // The lease points at the limit only so that it tests true; its deleter
  // gives the place back.
  auto self = shared_from_this();
  return std::shared_ptr<void>(static_cast<void*>(this), [self, uid](void*) { self->releaseOne(uid); });
}

void ConnectionLimit::setLimits(ConnectionLimits limits) {
  const std::lock_guard lock(mutex_);
  limits_ = limits;
}

ConnectionLimits ConnectionLimit::limits() const {
  const std::lock_guard lock(mutex_);
  return limits_;
}

std::size_t ConnectionLimit::count(uid_t uid) const {
  const std::lock_guard lock(mutex_);
  const auto it = live_.find(uid);
  return it == live_.end() ? 0 : it->second;
}

std::size_t ConnectionLimit::total() const {
  const std::lock_guard lock(mutex_);
  return total_;
}

bool ConnectionLimit::refusalWorthLogging(uid_t uid, std::chrono::steady_clock::time_point now) {
  const std::lock_guard lock(mutex_);
  const auto it = lastLogged_.find(uid);
  if (it != lastLogged_.end() && now - it->second < kRefusalLogInterval) return false;
  if (it == lastLogged_.end() && lastLogged_.size() >= kRememberedRefusals) {
    std::erase_if(lastLogged_, [&](const auto& entry) { return now - entry.second >= kRefusalLogInterval; });
    if (lastLogged_.size() >= kRememberedRefusals) return false;  // a storm of uids: stay quiet
  }
  lastLogged_[uid] = now;
  return true;
}

void ConnectionLimit::releaseOne(uid_t uid) {
  {
    const std::lock_guard lock(mutex_);
    --total_;
    const auto it = live_.find(uid);
    if (it != live_.end() && --it->second == 0) live_.erase(it);
  }
  activityEnded();  // the listener's connection count is lower: an idle exit looks again
}

}  // namespace relay::detail
