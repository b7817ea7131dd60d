#pragma once

// Reading application and plug-in bundles from disk for the registry, and
// the fingerprints that let a rescan skip bundles that did not change.
//
// Bundles are untrusted: every failure is a value naming the reason, files
// are read through bundle::readManifestFile (regular files only, size
// limited), names taken from documents must be plain file names, and
// nothing here writes.
//
// A fingerprint is a string made of (inode, size, modification and change
// times in nanoseconds, mode, owner) of each file a record is read from:
// Info.manifest, Entitlements.manifest, the executable, and
// Localized/*/InfoManifest.manifest, plus the caller's context stamp. Equal
// fingerprints mean "unchanged" without reading anything; see
// docs/registrar.md.

#include <optional>
#include <string>
#include <vector>

#include "platform/codesign/TrustSettings.h"
#include "platform/registrar/StoredRecords.h"
#include "platform/value/Result.h"

namespace registrar {

// Plug-ins may contain plug-ins (in their own Support/PlugIns) this deep.
inline constexpr int kMaxPlugInNesting = 4;
// Localized/ directories beyond this many languages are not read.
inline constexpr size_t kMaxLanguages = 256;
// The marker file of an install placeholder.
inline constexpr std::string_view kPlaceholderMarker = ".installing";

struct ReadContext {
  codesign::TrustSettings trust;
  std::string stamp;  // joins every fingerprint: changes of it force a re-read
};

// Why a bundle was skipped: one line for the log ("no Info.manifest", ...).
using SkipReason = std::string;

// The plug-in bundle at path (uuid, app path, dates and container are left
// for the caller).
tn::Result<StoredPlugIn> readPlugInBundle(const std::string& path, const ReadContext& context);

// The application at path; its plug-ins are listed by plugInBundlePaths.
tn::Result<StoredApp> readApplicationBundle(const std::string& path, const ReadContext& context);

// The fingerprint of a plug-in bundle whose Info.manifest holds info.
std::string plugInFingerprint(const std::string& path, const tn::Value& info, const ReadContext& context);
std::string applicationFingerprint(const std::string& path, const ReadContext& context);

// The bundle directories in <bundle>/Support/PlugIns and, nested, in theirs
// (up to kMaxPlugInNesting levels), sorted by path. Entries whose names
// start with "." are ignored; entries that are not directories (following
// links), including dangling links, are logged and skipped.
std::vector<std::string> plugInBundlePaths(const std::string& bundlePath);

// Directory entries of path, names starting with "." left out, sorted.
std::vector<std::string> directoryEntries(const std::string& path);

// The stamp of what every bundle's entitlements also depend on: the
// entitlements directory of trust (its own change times).
std::string entitlementsStamp(const codesign::TrustSettings& trust);

// Whether path (links followed) is a directory; reason says why not.
bool isDirectory(const std::string& path, std::string* reason = nullptr);

}  // namespace registrar
