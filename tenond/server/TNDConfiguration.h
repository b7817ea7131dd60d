#pragma once

// TNDConfiguration: the daemon's settings, from the administrator's document
// $TENON_ROOT/etc/tenon/tenond.manifest (TENON_ROOT empty or unset: /etc/...;
// a per-user instance: $XDG_CONFIG_HOME/tenon/tenond.manifest, InstancePaths.h),
// a structured-value document (XML or JSON) holding a dictionary:
//
//   {"privileged-groups": ["tenon-admin", 1001],
//    "connections-per-user": 64, "connections-total": 4096,
//    "termination-grace-seconds": 2, "idle-exit-seconds": 120}
//
// docs/configuration.md describes the keys for administrators. The document
// is read once, when the server is made, and only when it passes the trust
// rule of entitlement documents (owned by root or the daemon's user, written
// by nobody else, in directories nobody else can write to): a user who could
// write it could make himself privileged. A missing file means defaults. An
// untrusted or malformed file, or a key whose value has the wrong type or
// names an unknown group, gives one error line on the "ops" category naming
// the file (and the key), and that key's default. Unknown keys are named the
// same way and ignored.

#include <sys/types.h>

#include <cstddef>
#include <optional>
#include <string>
#include <vector>

#include "platform/relay/AuditToken.h"
#include "platform/value/Value.h"

namespace tnd {

struct TNDConfiguration {
  // "privileged-groups": group names or numbers; members may do what the
  // manager entitlement allows, besides root and the daemon's user. Default
  // none.
  std::vector<gid_t> privilegedGroups;
  // "connections-per-user": live connections one uid may have; positive.
  std::optional<std::size_t> connectionsPerUser;
  // "connections-total": live connections of all users together; positive.
  std::optional<std::size_t> connectionsTotal;
  // "termination-grace-seconds": how long a plug-in instance told to stop
  // (SIGTERM) may take before it is killed; 1 to 3600.
  std::optional<std::size_t> terminationGraceSeconds;
  // "idle-exit-seconds": how long a socket-activated daemon with no
  // connection, no hold and no running plug-in instance waits before it
  // exits (the service manager starts it again for the next client); 0
  // never, at most 86400. Default kDefaultIdleExitSeconds. A daemon that
  // bound its own socket never exits for idleness.
  static constexpr std::size_t kDefaultIdleExitSeconds = 120;
  std::optional<std::size_t> idleExitSeconds;

  // The configuration of $TENON_ROOT/etc/tenon/tenond.manifest (see above).
  static TNDConfiguration load();

  // The configuration a parsed document holds; path only names the file in
  // log lines. Logs as load() does.
  static TNDConfiguration fromDocument(const tn::Value& document, const std::string& path);

  // $TENON_ROOT/etc/tenon/tenond.manifest.
  static std::string path();

  // The daemon's one rule for privileged users: uid 0, the daemon's own
  // uid, or a member (primary or supplementary group, as of connect()) of a
  // group in "privileged-groups".
  bool isPrivilegedUser(const relay::AuditToken& token) const;
};

}  // namespace tnd
