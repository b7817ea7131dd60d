// ActivationOverlay: what a registration says about how to start a plug-in,
// read from the overlay the daemon hands addExternalService():
//
//   {"RelayService": {"EnvironmentVariables": {"HOME": "/...", ...},
//                     "_SandboxProfile": "plugin",
//                     "_OmitSandboxParameters": true, ...},
//    "BNBundlePackageType": "RLY!"}
//
// The overlay is checked strictly: it must be a dictionary whose
// "BNBundlePackageType" is "RLY!" and whose "RelayService" is a dictionary;
// "EnvironmentVariables", when present, a dictionary of strings whose names
// are non-empty and hold neither '=' nor NUL and whose values hold no NUL
// (at most 256 variables, 64 KiB in all); "_SandboxProfile", when present, a
// profile name (SandboxProfile.h). A missing profile means "plugin", the
// profile every plug-in gets unless its extension point calls for another;
// "_OmitSandboxParameters" is accepted and changes nothing, since this
// supervisor passes no parameters to profiles. Other keys of "RelayService"
// are kept, for the listing, and otherwise ignored.

#pragma once

#include <string>
#include <utility>
#include <vector>

#include "platform/value/Result.h"
#include "platform/value/Value.h"

namespace warden {

inline constexpr const char* kPackageType = "RLY!";
inline constexpr const char* kDefaultProfile = "plugin";
inline constexpr std::size_t kMaxEnvironmentVariables = 256;
inline constexpr std::size_t kMaxEnvironmentBytes = 64 * 1024;

struct ActivationOverlay {
  std::vector<std::pair<std::string, std::string>> environment;  // in the overlay's order
  std::string sandboxProfile = kDefaultProfile;

  // Errors: EINVAL (domain "warden") naming the key at fault.
  static tn::Result<ActivationOverlay> parse(const tn::Value& overlay);
};

}  // namespace warden
