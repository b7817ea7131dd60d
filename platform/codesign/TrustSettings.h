#pragma once

// Where entitlement documents for loose executables live, and which user
// besides root may own trusted files.

#include <sys/types.h>

#include <string>

namespace codesign {

struct TrustSettings {
  // The directory of *.manifest documents naming executables.
  std::string entitlementsDirectory;
  // Files owned by this user are trusted like root's: the daemon's own
  // effective user, since whoever can write as the daemon could change the
  // daemon itself.
  uid_t daemonUser = 0;

  // $TENON_ROOT/etc/tenon/entitlements.d (TENON_ROOT unset or empty means
  // "/etc/tenon/entitlements.d") and geteuid(), read when called.
  static TrustSettings fromEnvironment();
};

}  // namespace codesign
