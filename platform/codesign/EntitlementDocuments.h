#pragma once

// Finding the entitlement documents of an executable, checking them against
// the trust rule, and merging what they grant.
//
// Documents, in the order they are merged (a later document's value for a
// key replaces an earlier one's, so an administrator's file in
// entitlements.d overrides what a bundle ships):
//   1. <bundle>/Entitlements.manifest of the bundle the executable lies in
//      (bundle::findEnclosingBundle): a dictionary of entitlements.
//   2. Every <name>.manifest in the entitlements directory, in byte order of
//      the names (names starting with "." are skipped), whose document has
//      the shape
//        {"executable": "/usr/bin/tnctl", "entitlements": {"key": value, ...}}
//      and whose "executable", links resolved, is the executable's path,
//      links resolved.
//
// Nothing is granted unless the executable itself passes the trust rule; a
// document counts only when it passes too. Every document that is refused
// for its contents (unreadable, malformed, not of the shape above) or, when
// it applies to this executable, for the trust rule, is named on the "ops"
// log category at error level with the reason:
//   "ignoring entitlements in <file>: <reason>"
//   "ignoring entitlements of executable <path>: <reason>"
// Documents in entitlements.d naming other executables are skipped quietly.

#include <string>

#include "platform/codesign/TrustSettings.h"
#include "platform/value/Value.h"

namespace codesign {

// Keys of a document in the entitlements directory.
inline constexpr std::string_view kExecutableKey = "executable";
inline constexpr std::string_view kEntitlementsKey = "entitlements";

// The merged entitlements the trusted documents grant the executable at
// executablePath (absolute): always a dictionary value, empty when nothing
// is granted. Reads the file system; logs as described above.
tn::Value loadEntitlements(const std::string& executablePath, const TrustSettings& settings);

}  // namespace codesign
