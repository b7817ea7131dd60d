#pragma once

// Keys of bundle information dictionaries and plug-in dictionaries that the
// plug-in model reads, and the keys of plug-in forms.

#include <string_view>

namespace tn::keys {

// Bundle information dictionary (Info.manifest).
inline constexpr std::string_view kXTExtension = "XTExtension";  // the plug-in dictionary
inline constexpr std::string_view kTenon = "Tenon";              // marks an old-style bundle
inline constexpr std::string_view kBundleIdentifier = "BNBundleIdentifier";
inline constexpr std::string_view kBundleDisplayName = "BNBundleDisplayName";
inline constexpr std::string_view kBundleName = "BNBundleName";
inline constexpr std::string_view kBundleShortVersionString = "BNBundleShortVersionString";
inline constexpr std::string_view kBundleInfoManifestURL = "BNBundleInfoManifestURL";

// Plug-in dictionary ("XTExtension").
inline constexpr std::string_view kIdentifier = "XTExtensionIdentifier";
inline constexpr std::string_view kAttributes = "XTExtensionAttributes";
inline constexpr std::string_view kVersion = "XTExtensionVersion";  // inside the attributes
inline constexpr std::string_view kProtocol = "XTExtensionProtocol";
inline constexpr std::string_view kPrincipalClass = "PrincipalClass";
inline constexpr std::string_view kExtensionPointIdentifier = "XTExtensionPointIdentifier";
inline constexpr std::string_view kEmbeddedProtocol = "EmbeddedProtocol";
inline constexpr std::string_view kEmbeddedCode = "EmbeddedCode";
inline constexpr std::string_view kDedicated = "Dedicated";
inline constexpr std::string_view kPassProxy = "PassProxy";
inline constexpr std::string_view kMultiple = "Multiple";
inline constexpr std::string_view kHubProtocolVersion = "HubProtocolVersion";
inline constexpr std::string_view kShared = "Shared";
inline constexpr std::string_view kCleanTimeout = "CleanTimeout";
inline constexpr std::string_view kFileSourceActions = "XTExtensionFileSourceActions";
inline constexpr std::string_view kFileSourceActionName = "XTExtensionFileSourceActionName";

// Values.
inline constexpr std::string_view kDefaultObject = "XTObject";  // application extensions' protocol and class
inline constexpr std::string_view kDataProtocol = "#Data";
inline constexpr std::string_view kAppExtensionSuffix = ".tnx";
inline constexpr std::string_view kLocalizableTable = "Localizable";

}  // namespace tn::keys

namespace tn::formkeys {

// Always written by export, in this order.
inline constexpr std::string_view kHubProtocolVersion = "hubProtocolVersion";
inline constexpr std::string_view kPath = "path";
inline constexpr std::string_view kSystemResident = "systemResident";
inline constexpr std::string_view kIdentifier = "identifier";
inline constexpr std::string_view kOriginalIdentifier = "original-identifier";
inline constexpr std::string_view kVersion = "version";
inline constexpr std::string_view kBundleInfo = "bundleInfo";
inline constexpr std::string_view kInfo = "info";
inline constexpr std::string_view kUUID = "uuid";
inline constexpr std::string_view kLastModified = "lastmodified";
inline constexpr std::string_view kAnnotations = "annotations";
// Written when the record has them, in this order.
inline constexpr std::string_view kEntitlements = "entitlements";
inline constexpr std::string_view kContainingPath = "containingPath";
inline constexpr std::string_view kLocalizedContainingDisplayName = "localizedContainingDisplayName";
inline constexpr std::string_view kLocalizedDisplayName = "localizedDisplayName";
inline constexpr std::string_view kLocalizedShortName = "localizedShortName";
inline constexpr std::string_view kLocalizedFileSourceActionNames = "localizedFileSourceActionNames";
// Added to daemon replies by others; read by nobody here.
inline constexpr std::string_view kExtensions = "extensions";
inline constexpr std::string_view kServiceExtension = "service-extension";
// Read on import, never written by export.
inline constexpr std::string_view kHash = "hash";
inline constexpr std::string_view kRequirement = "requirement";

inline constexpr std::string_view kNoVersion = "<none>";

}  // namespace tn::formkeys
