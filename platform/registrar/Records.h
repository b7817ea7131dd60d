#pragma once

// The registry's records: immutable value objects handed out as
// shared_ptr<const ...>. A record never changes after it is made; when the
// registry learns something new (a rescan, a locale change) it makes new
// records, and the old ones stay valid for whoever still holds them.

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/value/Date.h"
#include "platform/value/URL.h"
#include "platform/value/UUID.h"
#include "platform/value/Value.h"

namespace registrar {

// Keys of information dictionaries that the registry reads.
inline constexpr std::string_view kExtensionKey = "XTExtension";
inline constexpr std::string_view kExtensionIdentifierKey = "XTExtensionIdentifier";
inline constexpr std::string_view kExtensionPointIdentifierKey = "XTExtensionPointIdentifier";
inline constexpr std::string_view kExtensionProtocolKey = "XTExtensionProtocol";
inline constexpr std::string_view kExtensionAttributesKey = "XTExtensionAttributes";
inline constexpr std::string_view kBundleIdentifierKey = "BNBundleIdentifier";
inline constexpr std::string_view kBundleVersionKey = "BNBundleVersion";
inline constexpr std::string_view kBundleDisplayNameKey = "BNBundleDisplayName";
inline constexpr std::string_view kBundleNameKey = "BNBundleName";
inline constexpr std::string_view kDataProtocol = "#Data";
inline constexpr std::string_view kAppExtensionSuffix = ".tnx";

// An installed application: a bundle directly inside an application root.
class AppRecord {
 public:
  struct Fields {
    std::string bundlePath;                 // absolute, normalised, no trailing slash
    std::optional<std::string> identifier;  // "BNBundleIdentifier"
    std::optional<std::string> localizedName;
    bool placeholder = false;               // holds a ".installing" file
    bool onSystemPartition = false;         // lies under $TENON_ROOT/System/
    tn::Value infoDictionary;               // null for a placeholder without a manifest
    std::vector<tn::UUID> plugInUUIDs;      // its plug-ins, ordered by bundle path
  };

  explicit AppRecord(Fields fields) : fields_(std::move(fields)) {}

  tn::URL bundleURL() const { return tn::URL::fileURLWithPath(fields_.bundlePath); }
  const std::string& bundlePath() const { return fields_.bundlePath; }
  const std::optional<std::string>& identifier() const { return fields_.identifier; }
  const std::optional<std::string>& localizedName() const { return fields_.localizedName; }
  bool isPlaceholder() const { return fields_.placeholder; }
  bool onSystemPartition() const { return fields_.onSystemPartition; }
  const tn::Value& infoDictionary() const { return fields_.infoDictionary; }
  const std::vector<tn::UUID>& plugInUUIDs() const { return fields_.plugInUUIDs; }

 private:
  Fields fields_;
};

// An installed plug-in bundle, with everything the daemon's plug-in record
// is built from.
class PlugInRecord {
 public:
  struct Fields {
    tn::UUID uuid;
    std::string bundlePath;                          // absolute, normalised, no trailing slash
    std::shared_ptr<const AppRecord> containingApp;  // null outside any application
    std::optional<std::string> bundleIdentifier;     // "BNBundleIdentifier"
    std::string identifier;                          // "XTExtensionIdentifier", else the bundle identifier
    std::optional<std::string> bundleVersion;        // "BNBundleVersion"
    tn::Value plugInDictionary;                      // the "XTExtension" dictionary
    tn::Value infoDictionary;                        // the whole Info.manifest
    tn::Date registrationDate;                       // when this UUID was given
    bool onSystemPartition = false;
    std::optional<std::string> localizedName;        // in the locale the record was made for
    std::optional<std::string> localizedShortName;
    tn::Value entitlements;                          // a dictionary, empty when none are trusted
    std::optional<std::string> dataContainerPath;    // none for data plug-ins
    bool registeredByURL = false;                    // added with registerPlugIn, not found in a root
  };

  explicit PlugInRecord(Fields fields) : fields_(std::move(fields)) {}

  const tn::UUID& uuid() const { return fields_.uuid; }
  tn::URL bundleURL() const { return tn::URL::fileURLWithPath(fields_.bundlePath); }
  const std::string& bundlePath() const { return fields_.bundlePath; }
  const std::shared_ptr<const AppRecord>& containingApp() const { return fields_.containingApp; }
  const std::optional<std::string>& bundleIdentifier() const { return fields_.bundleIdentifier; }
  const std::string& identifier() const { return fields_.identifier; }
  // The registry renames nothing, so this is the identifier as declared.
  const std::string& originalIdentifier() const { return fields_.identifier; }
  const std::optional<std::string>& bundleVersion() const { return fields_.bundleVersion; }
  const tn::Value& plugInDictionary() const { return fields_.plugInDictionary; }
  const tn::Value& infoDictionary() const { return fields_.infoDictionary; }
  const tn::Date& registrationDate() const { return fields_.registrationDate; }
  bool onSystemPartition() const { return fields_.onSystemPartition; }
  const std::optional<std::string>& localizedName() const { return fields_.localizedName; }
  const std::optional<std::string>& localizedShortName() const { return fields_.localizedShortName; }
  const tn::Value& entitlements() const { return fields_.entitlements; }
  const std::optional<std::string>& dataContainerPath() const { return fields_.dataContainerPath; }
  std::optional<tn::URL> dataContainerURL() const {
    if (!fields_.dataContainerPath) return std::nullopt;
    return tn::URL::fileURLWithPath(*fields_.dataContainerPath);
  }
  bool registeredByURL() const { return fields_.registeredByURL; }

  // "XTExtensionPointIdentifier" of the plug-in dictionary, when a string.
  std::optional<std::string> extensionPointIdentifier() const;
  // The bundle directory's name ends in ".tnx".
  bool isAppExtension() const;
  // "XTExtensionProtocol" is the string "#Data".
  bool isData() const;

 private:
  Fields fields_;
};

// An extension point with the SDK dictionary from
// $TENON_ROOT/usr/share/tenon/extension-points/<identifier>.manifest.
class ExtensionPointRecord {
 public:
  ExtensionPointRecord(std::string identifier, std::string path, tn::Value sdkDictionary)
      : identifier_(std::move(identifier)), path_(std::move(path)), sdk_(std::move(sdkDictionary)) {}

  const std::string& identifier() const { return identifier_; }
  const std::string& path() const { return path_; }
  // A dictionary shaped like a bundle information dictionary.
  const tn::Value& sdkDictionary() const { return sdk_; }

 private:
  std::string identifier_;
  std::string path_;
  tn::Value sdk_;
};

using PlugInPtr = std::shared_ptr<const PlugInRecord>;
using AppPtr = std::shared_ptr<const AppRecord>;
using ExtensionPointPtr = std::shared_ptr<const ExtensionPointRecord>;
using PlugInList = std::vector<PlugInPtr>;

}  // namespace registrar
