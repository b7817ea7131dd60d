#pragma once

// Finding the entitlement documents of a running executable, checking them
// against the trust rule, and merging what they grant.
//
// Documents, in the order they are merged (a later document's value for a
// key replaces an earlier one's, so an administrator's file in
// entitlements.d overrides what a bundle ships):
//   1. <bundle>/Entitlements.manifest of the bundle the executable's path
//      lies in (bundle::findEnclosingBundle): a dictionary of entitlements.
//      It counts only when the file at the executable's path, as this
//      process sees it, is the very file the process runs (same device and
//      inode).
//   2. Every <name>.manifest in the entitlements directory, in byte order of
//      the names (names starting with "." are skipped), whose document has
//      the shape
//        {"executable": "/usr/bin/tnctl", "entitlements": {"key": value, ...}}
//      and whose "executable", every link followed (a final link too), is
//      the very file the process runs (same device and inode).
//
// Order of the checks, so that nothing a peer controls is read for an
// untrusted executable:
//   - the running file (the open descriptor, not a path) must pass the trust
//     rule; otherwise nothing is granted, the bundle is not even looked at,
//     and one line names the executable when a document of entitlements.d
//     names it;
//   - each document is checked against the rule on the open file before it
//     is read; a document that fails is not read (and so, for entitlements.d,
//     its target is unknown: it is named for every process);
//   - documents are parsed through the DocumentCache.
// Refusals are named on the "ops" log category at error level:
//   "ignoring entitlements in <file>: <reason>"
//   "ignoring entitlements of executable <path>: <reason>"
// Well-formed documents in entitlements.d naming other executables are
// skipped quietly.

#include <string>

#include "platform/codesign/TrustSettings.h"
#include "platform/value/Value.h"

namespace codesign {

// Keys of a document in the entitlements directory.
inline constexpr std::string_view kExecutableKey = "executable";
inline constexpr std::string_view kEntitlementsKey = "entitlements";

// The merged entitlements the trusted documents grant the process running
// the file open as executableFd (an O_PATH descriptor is enough; it is not
// read), whose absolute path as this process sees it is executablePath
// (used to find its bundle and in log lines). Always a dictionary value,
// empty when nothing is granted or executableFd is negative. Reads the file
// system; logs as described above.
tn::Value loadEntitlements(const std::string& executablePath, int executableFd, const TrustSettings& settings);

// The same for an executable that is not running, such as a plug-in's read by
// the registrar: the file at executablePath (links followed) is the one
// judged.
tn::Value loadEntitlements(const std::string& executablePath, const TrustSettings& settings);

}  // namespace codesign
