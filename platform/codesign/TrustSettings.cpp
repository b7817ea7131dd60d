#include "platform/codesign/TrustSettings.h"

#include "platform/paths/InstancePaths.h"

#include <unistd.h>

#include <cstdlib>

namespace codesign {

TrustSettings TrustSettings::fromEnvironment() {
  TrustSettings settings;
  settings.entitlementsDirectory = paths::platformRoot() + "/etc/tenon/entitlements.d";
  settings.daemonUser = ::geteuid();
  return settings;
}

}  // namespace codesign
