// ConnectionLimit: how many live connections each user may hold on one
// listener.
//
// A connection takes a lease for its peer's uid when it is accepted and
// gives it back when its socket closes. A user at the limit has further
// connections closed at once, so one user cannot exhaust the daemon's file
// descriptors for everybody else.
//
// Threads: any. Leases keep the limit object alive.

#pragma once

#include <sys/types.h>

#include <cstddef>
#include <memory>
#include <mutex>
#include <unordered_map>

namespace relay::detail {

class ConnectionLimit : public std::enable_shared_from_this<ConnectionLimit> {
 public:
  explicit ConnectionLimit(std::size_t perUser) : perUser_(perUser) {}

  // A lease for one connection of `uid`, or null when the user is at the limit.
  std::shared_ptr<void> acquire(uid_t uid);

  void setPerUser(std::size_t perUser);
  std::size_t count(uid_t uid) const;

 private:
  void releaseOne(uid_t uid);

  mutable std::mutex mutex_;
  std::size_t perUser_;                           // guarded by mutex_
  std::unordered_map<uid_t, std::size_t> live_;  // guarded by mutex_
};

}  // namespace relay::detail
