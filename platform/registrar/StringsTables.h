#pragma once

// Strings tables of bundles (Localized/<language>/<table>.manifest, a
// dictionary of key to localized string), read on demand and cached until
// clear() — the registry's "schema caches". Thread-safe.

#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "platform/value/Value.h"

namespace registrar {

using LocalizedStrings = std::map<std::string, std::string, std::less<>>;

class StringsTables {
 public:
  // The strings of keys found along languages (first language first) in
  // the table of the bundle; none when no language has the table. table
  // and languages must be plain file names; others are never read.
  std::optional<LocalizedStrings> lookup(const std::string& bundlePath, std::string_view table,
                                         const std::vector<std::string>& languages,
                                         const std::set<std::string, std::less<>>& keys);
  void clear();
  size_t cachedCount();

 private:
  // The table file's dictionary, or null when it is missing or unusable.
  std::shared_ptr<const tn::Value> table(const std::string& path);

  std::mutex mutex_;
  std::unordered_map<std::string, std::shared_ptr<const tn::Value>> cache_;  // guarded by mutex_
};

}  // namespace registrar
