#pragma once

// platform/codesign: entitlements of a process (library tn_codesign).
//
// Linux has no code signing, so this folder stands in for it with documents
// the system trusts only when the process claiming them cannot have written
// them. A process's entitlements come from
//   - Entitlements.manifest beside the Info.manifest of the bundle its
//     executable lies in (a dictionary of entitlements), and
//   - $TENON_ROOT/etc/tenon/entitlements.d/*.manifest, each a dictionary
//     {"executable": "<absolute path>", "entitlements": {...}} for loose
//     executables such as command-line tools,
// bound to the file the process runs (its device and inode, not its path),
// and a document counts only when it and the executable pass the trust rule
// (TrustRule.h): owned by root or the daemon's own user, not writable by
// group or others, and in directories nobody else can write to unless they
// are sticky. Everything else is ignored with an error line on the "ops" log
// category naming the file and the reason. docs/bundles-and-trust.md
// describes the documents for administrators.
//
//   ProcessIdentity.h       the process fields a handle is made from
//   FileIdentity.h          device and inode: which file a process runs
//   TaskHandle.h            a process with its entitlements; entitlementValue()
//   EntitlementGrant.h      entitlementIsGranted(): when a value grants
//   EntitlementDocuments.h  finding, checking and merging the documents
//   DocumentCache.h         documents parsed once while unchanged
//   TrustRule.h             the ownership and permission rule
//   TrustSettings.h         where documents live and whom to trust
//
// Depends on platform/value, platform/bundle and platform/log.

#include "platform/codesign/DocumentCache.h"
#include "platform/codesign/EntitlementDocuments.h"
#include "platform/codesign/EntitlementGrant.h"
#include "platform/codesign/FileIdentity.h"
#include "platform/codesign/ProcessIdentity.h"
#include "platform/codesign/TaskHandle.h"
#include "platform/codesign/TrustRule.h"
#include "platform/codesign/TrustSettings.h"
