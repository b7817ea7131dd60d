// platform/vigil: busy assertions of running plug-in instances (library
// tn_vigil, namespace vigil).
//
// Stands in for the platform's process-assertion service inside tenond. A
// plug-in instance that the supervisor started (platform/warden) declares
// itself busy or idle over the relay service "com.ostrel.tenon.vigil":
//
//   {"request": "busy"}  -> {}      the instance is working; don't stop it
//   {"request": "idle"}  -> {}      it may be stopped again
//   {"request": "busy-instances", "identifiers": ["com.example.a", ...]}
//                        -> {"instances": [...]}, as busyInstances(); only
//                           for privileged peers (the daemon's rule)
//   failures: {"errorcode": <errno number>, "error": "<why>"}
//
// The service knows the instance by its connection's peer (pid, start time,
// from SO_PEERCRED and its pidfd), which must be an instance the supervisor
// runs now; any other process is refused (EPERM) and leaves nothing behind.
// An assertion ends with the instance's connection, or when the instance
// exits, whichever comes first (the supervisor's record is checked when
// busy instances are asked for). So at most one assertion exists per
// connection of a running instance: the state is bounded by the
// supervisor's instance limit and the relay's connection limits.
//
// busyInstances() answers the daemon's question ("is an instance of this
// plug-in busy?"): one dictionary per busy instance, whose bundle
// identifier is under kBundleIdentifierKey.
//
// Threads: any; state under one mutex held only for lookups and updates.

#pragma once

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <vector>

#include "platform/relay/Listener.h"
#include "platform/value/Result.h"
#include "platform/value/Value.h"
#include "platform/warden/Warden.h"

namespace vigil {

inline constexpr const char* kVigilServiceName = "com.ostrel.tenon.vigil";
// The key of a busy instance's bundle identifier in busyInstances().
inline constexpr const char* kBundleIdentifierKey = "BNBundleIdentifier";

class Vigil : public std::enable_shared_from_this<Vigil> {
 public:
  // Listens as `serviceName`, resumed at once, and checks instances with
  // `warden`. Errors: those of relay::Listener::create.
  using PrivilegeTest = std::function<bool(const relay::PeerIdentity&)>;

  static tn::Result<std::shared_ptr<Vigil>> create(std::shared_ptr<warden::Warden> warden,
                                                   PrivilegeTest isPrivileged,
                                                   const std::string& serviceName = kVigilServiceName);
  ~Vigil();
  Vigil(const Vigil&) = delete;
  Vigil& operator=(const Vigil&) = delete;

  // Its clients' connections that have not ended.
  std::size_t connectionCount() const { return listener_->connectionCount(); }

  // The busy instances whose bundle identifier is in `bundleIdentifiers`,
  // each {"BNBundleIdentifier": ..., "BNBundleVersion": ..., "pid": N}, in
  // the order they became busy.
  std::vector<tn::Value> busyInstances(const std::set<std::string>& bundleIdentifiers) const;

  // Records the declaration of the process (pid, startTime) on connection
  // `key`. Errors: EPERM for a process that is no running instance.
  tn::Result<void> declare(const void* key, pid_t pid, uint64_t startTime, bool busy);
  // The connection `key` ended: its assertion goes.
  void connectionEnded(const void* key);

 private:
  Vigil(std::shared_ptr<warden::Warden> warden, PrivilegeTest isPrivileged)
      : warden_(std::move(warden)), isPrivileged_(std::move(isPrivileged)) {}
  void accept(const std::shared_ptr<relay::Connection>& connection);
  tn::Value answer(const void* key, const relay::Connection& connection, const tn::Value& request);

  struct Assertion {
    warden::InstanceInfo instance;
    uint64_t order = 0;  // when it became busy
  };

  const std::shared_ptr<warden::Warden> warden_;
  const PrivilegeTest isPrivileged_;
  std::shared_ptr<relay::Listener> listener_;
  mutable std::mutex mutex_;
  std::map<const void*, Assertion> busy_;  // guarded by mutex_: by connection
  uint64_t nextOrder_ = 0;                 // guarded by mutex_
};

}  // namespace vigil
