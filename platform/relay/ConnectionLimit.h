// ConnectionLimit: how many live connections a listener takes, per user and
// in all.
//
// A connection takes a lease for its peer's uid when it is accepted (on the
// I/O thread, from SO_PEERCRED, before anything else is allocated for it)
// and gives it back when its socket closes. A user at the per-user limit, or
// any user when the total is reached, has further connections closed at
// once, so one user cannot exhaust the daemon's file descriptors for
// everybody else. The last `privilegedReserve` places of the total are kept
// for root and the process's own user, so that an administrator can still
// reach a daemon that many users crowd.
//
// Refusals are for the log; refusalWorthLogging() says whether to name one,
// at most once a minute per uid, so that a user hammering the socket cannot
// flood the log either.
//
// Threads: any. Leases keep the limit object alive.

#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstddef>
#include <limits>
#include <memory>
#include <mutex>
#include <unordered_map>

namespace relay::detail {

struct ConnectionLimits {
  std::size_t perUser = 64;
  std::size_t total = std::numeric_limits<std::size_t>::max();
  std::size_t privilegedReserve = 0;
};

class ConnectionLimit : public std::enable_shared_from_this<ConnectionLimit> {
 public:
  enum class Refusal { None, PerUser, Total };

  explicit ConnectionLimit(ConnectionLimits limits) : limits_(limits) {}

  // A lease for one connection of `uid`, or null (with `why` set) when the
  // user or the listener is at its limit.
  std::shared_ptr<void> acquire(uid_t uid, Refusal* why = nullptr);

  void setLimits(ConnectionLimits limits);
  ConnectionLimits limits() const;
  std::size_t count(uid_t uid) const;
  std::size_t total() const;

  // True when a refusal of `uid` at `now` should be logged: the first one,
  // and then at most one a minute. Remembers at most a few thousand uids.
  bool refusalWorthLogging(uid_t uid, std::chrono::steady_clock::time_point now);

 private:
  void releaseOne(uid_t uid);
  static bool isPrivileged(uid_t uid);

  mutable std::mutex mutex_;
  ConnectionLimits limits_;                      // guarded by mutex_
  std::unordered_map<uid_t, std::size_t> live_;  // guarded by mutex_
  std::size_t total_ = 0;                        // guarded by mutex_
  std::unordered_map<uid_t, std::chrono::steady_clock::time_point> lastLogged_;  // guarded by mutex_
};

}  // namespace relay::detail
