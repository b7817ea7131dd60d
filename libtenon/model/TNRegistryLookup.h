#pragma once

// TNRegistryLookup: the two questions the plug-in model asks the platform
// registry. The model never reaches the registry directly: whoever builds
// records (the daemon, tnctl lint, tests) hands it an implementation, so the
// model stays usable in client processes and testable without a registry.
//
// Implementations must be safe to call from several queues at once; both
// operations only read.

#include <map>
#include <optional>
#include <set>
#include <string>
#include <string_view>

#include "platform/value/URL.h"
#include "platform/value/Value.h"

namespace tn {

class TNRegistryLookup {
 public:
  virtual ~TNRegistryLookup() = default;

  // The SDK dictionary registered for the extension point with this
  // identifier: a dictionary shaped like a bundle information dictionary.
  // None when no such extension point is registered or it has no SDK
  // dictionary (or one that is not a dictionary).
  virtual std::optional<Dictionary> sdkDictionary(std::string_view extensionPointIdentifier) const = 0;

  // The localized strings, in the user's current language, of keys from the
  // strings table named table ("Localizable") of the plug-in bundle at
  // plugInBundle. The map holds an entry only for the keys the table has a
  // string for; none when the bundle or the table cannot be found at all.
  using LocalizedStrings = std::map<std::string, std::string, std::less<>>;
  virtual std::optional<LocalizedStrings> localizedStrings(const URL& plugInBundle, std::string_view table,
                                                           const std::set<std::string, std::less<>>& keys) const = 0;
};

}  // namespace tn
