#pragma once

// What the store keeps for each application, plug-in and extension point:
// the facts read from disk, without anything derived from the locale.
// Records (Records.h) are made from these.

#include <optional>
#include <string>

#include "platform/value/Date.h"
#include "platform/value/UUID.h"
#include "platform/value/Value.h"

namespace registrar {

// Value::identical, without walking a dictionary both sides share: facts
// kept from one scan to the next are copies of one immutable value, and a
// rescan compares every one of them.
inline bool sameValue(const tn::Value& a, const tn::Value& b) {
  const tn::Dictionary* dictionary = a.dictionary();
  if (dictionary != nullptr && dictionary == b.dictionary()) return true;
  return tn::Value::identical(a, b);
}

struct StoredApp {
  std::string path;
  bool placeholder = false;
  tn::Value info;           // Info.manifest; null for a placeholder without one
  tn::Value localizations;  // language -> its InfoManifest.manifest names
  std::string fingerprint;  // see BundleReader.h

  // Same facts, fingerprint aside.
  bool sameContents(const StoredApp& other) const {
    return placeholder == other.placeholder && sameValue(info, other.info) &&
           sameValue(localizations, other.localizations);
  }
};

struct StoredPlugIn {
  tn::UUID uuid;
  std::string path;
  std::optional<std::string> appPath;  // the containing application
  bool registeredByURL = false;
  std::string identifier;
  tn::Value info;
  tn::Value entitlements;
  tn::Value localizations;
  std::optional<std::string> container;  // data container directory
  tn::Date registered;
  std::string fingerprint;

  // Same bundle contents in the same place: nothing a record shows differs
  // (identity, dates, container and fingerprint aside).
  bool sameContents(const StoredPlugIn& other) const {
    return path == other.path && appPath == other.appPath && registeredByURL == other.registeredByURL &&
           identifier == other.identifier && sameValue(info, other.info) &&
           sameValue(entitlements, other.entitlements) && sameValue(localizations, other.localizations);
  }
};

struct StoredExtensionPoint {
  std::string identifier;
  std::string path;
  tn::Value sdk;
  std::string fingerprint;
};

}  // namespace registrar
