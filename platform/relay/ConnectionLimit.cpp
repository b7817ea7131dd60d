#include "platform/relay/ConnectionLimit.h"

namespace relay::detail {

std::shared_ptr<void> ConnectionLimit::acquire(uid_t uid) {
  {
    const std::lock_guard lock(mutex_);
    std::size_t& live = live_[uid];
    if (live >= perUser_) return nullptr;
    ++live;
  }
  // The lease points at the limit only so that it tests true; its deleter
  // gives the place back.
  auto self = shared_from_this();
  return std::shared_ptr<void>(static_cast<void*>(this), [self, uid](void*) { self->releaseOne(uid); });
}

void ConnectionLimit::setPerUser(std::size_t perUser) {
  const std::lock_guard lock(mutex_);
  perUser_ = perUser;
}

std::size_t ConnectionLimit::count(uid_t uid) const {
  const std::lock_guard lock(mutex_);
  const auto it = live_.find(uid);
  return it == live_.end() ? 0 : it->second;
}

void ConnectionLimit::releaseOne(uid_t uid) {
  const std::lock_guard lock(mutex_);
  const auto it = live_.find(uid);
  if (it != live_.end() && --it->second == 0) live_.erase(it);
}

}  // namespace relay::detail
