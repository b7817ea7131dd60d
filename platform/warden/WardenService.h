// WardenService: the supervisor's relay service, "com.ostrel.tenon.warden"
// (docs/warden.md has the protocol).
//
//   {"request": "start", "plug-in": "<bundle identifier or /path/of/executable>"}
//     -> {"pid": N, "BNBundleIdentifier": "...", "BNBundleVersion": "..."}
//        and one descriptor: the host's end of the plug-in's socket
//   {"request": "list"}
//     -> {"registrations": [...], "instances": [...]}: everything for a
//        privileged user, the caller's own otherwise
//   failures: {"errorcode": <errno number>, "error": "<why>"}
//
// For tests only, and only when the supervisor's process was started with
// TENON_WARDEN_TEST_HOOKS=1 in its environment: a peer running as root or
// as the supervisor's own user may register directly, as the daemon does
// when a host readies plug-ins:
//   {"request": "register", "host": <pid>, "executable": "/...", "overlay": {...}}
//     -> {} or a failure
// Without the variable the request is unknown, whoever asks.
//
// The caller is who the relay identified when it connected (SO_PEERCRED
// and its pidfd): a host can start only what was registered for that very
// process. Requests bring no descriptors (the listener refuses any).
//
// Threads: each connection's requests run on its own queue; a start forks
// there, so one host's start never holds another's.

#pragma once

#include <functional>
#include <memory>
#include <string>

#include "platform/relay/Listener.h"
#include "platform/relay/PeerIdentity.h"
#include "platform/value/Result.h"
#include "platform/warden/Warden.h"

namespace warden {

inline constexpr const char* kWardenServiceName = "com.ostrel.tenon.warden";

class WardenService {
 public:
  // Decides whether a peer may see every registration and instance.
  using PrivilegeTest = std::function<bool(const relay::PeerIdentity&)>;

  // Listens as `serviceName`; resumed at once. Errors: those of
  // relay::Listener::create.
  static tn::Result<std::unique_ptr<WardenService>> create(std::shared_ptr<Warden> warden,
                                                           PrivilegeTest isPrivileged,
                                                           const std::string& serviceName = kWardenServiceName);
  ~WardenService();

  // Its clients' connections that have not ended.
  std::size_t connectionCount() const { return listener_->connectionCount(); }

  // The reply to one request of `peer` (without the descriptor a start
  // hands over, which goes to `hostSocket`).
  static tn::Value answer(Warden& warden, const PrivilegeTest& isPrivileged, const relay::PeerIdentity& peer,
                          const tn::Value& request, relay::UniqueFd& hostSocket);

 private:
  WardenService(std::shared_ptr<Warden> warden, PrivilegeTest isPrivileged);
  static void accept(const std::shared_ptr<relay::Connection>& connection, std::shared_ptr<Warden> warden,
                     PrivilegeTest isPrivileged);

  const std::shared_ptr<Warden> warden_;
  const PrivilegeTest isPrivileged_;
  std::shared_ptr<relay::Listener> listener_;
};

}  // namespace warden
