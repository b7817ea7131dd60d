#pragma once

// The names that make up a bundle on disk, in one place:
//
//   Name/
//     Info.manifest              the information dictionary (XML or JSON document)
//     Entitlements.manifest      optional: entitlements of the bundle's executable
//     bin/<BNBundleExecutable>   the executable (data-only plug-ins have none)
//     Support/                   the support-files directory
//       PlugIns/                 plug-in bundles an application contains
//     Localized/<language>/      localized strings and information dictionary

#include <string_view>

namespace bundle {

inline constexpr std::string_view kInfoManifestName = "Info.manifest";
inline constexpr std::string_view kEntitlementsManifestName = "Entitlements.manifest";
inline constexpr std::string_view kExecutableDirectoryName = "bin";
inline constexpr std::string_view kSupportDirectoryName = "Support";
inline constexpr std::string_view kPlugInsDirectoryName = "PlugIns";
inline constexpr std::string_view kLocalizedDirectoryName = "Localized";

// Keys of the information dictionary this layer reads.
inline constexpr std::string_view kBundleExecutableKey = "BNBundleExecutable";
inline constexpr std::string_view kBundleIdentifierKey = "BNBundleIdentifier";

// True when name can stand for one entry of a directory: not empty, not "."
// or "..", no "/" and no NUL, at most 255 bytes. Names taken from documents
// (BNBundleExecutable) must pass this before they are joined to a path, so a
// document can never point outside its bundle.
bool isPlainFileName(std::string_view name);

}  // namespace bundle
