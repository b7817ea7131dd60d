#include "platform/codesign/TrustSettings.h"

#include <unistd.h>

#include <cstdlib>

namespace codesign {

TrustSettings TrustSettings::fromEnvironment() {
  const char* root = std::getenv("TENON_ROOT");
  TrustSettings settings;
  settings.entitlementsDirectory = std::string(root != nullptr ? root : "") + "/etc/tenon/entitlements.d";
  settings.daemonUser = ::geteuid();
  return settings;
}

}  // namespace codesign
