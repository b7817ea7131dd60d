#include "platform/registrar/StringsTables.h"

#include <unistd.h>

#include "platform/bundle/BundleLayout.h"
#include "platform/bundle/ManifestFile.h"
#include "platform/log/Log.h"

namespace registrar {

std::shared_ptr<const tn::Value> StringsTables::table(const std::string& path) {
  {
    const std::lock_guard lock(mutex_);
    if (auto found = cache_.find(path); found != cache_.end()) return found->second;
  }
  auto contents = std::make_shared<tn::Value>();
  if (::access(path.c_str(), F_OK) == 0) {
    tn::Result<tn::Value> read = bundle::readManifestFile(path);
    if (read && read->isDictionary()) {
      *contents = std::move(*read);
    } else {
      TN_LOG_ERROR(tn::log::rg(), "ignoring strings table {}: {}", path,
                   read ? std::string("not a dictionary") : read.error().message().value_or(""));
    }
  }
  const std::lock_guard lock(mutex_);
  return cache_.emplace(path, std::move(contents)).first->second;
}

std::optional<LocalizedStrings> StringsTables::lookup(const std::string& bundlePath, std::string_view table,
                                                      const std::vector<std::string>& languages,
                                                      const std::set<std::string, std::less<>>& keys) {
  if (!bundle::isPlainFileName(std::string(table) + ".manifest")) return std::nullopt;
  LocalizedStrings strings;
  bool anyTable = false;
  for (const std::string& language : languages) {
    if (!bundle::isPlainFileName(language)) continue;
    const std::string path = bundlePath + "/" + std::string(bundle::kLocalizedDirectoryName) + "/" + language + "/" +
                             std::string(table) + ".manifest";
    const std::shared_ptr<const tn::Value> contents = this->table(path);
    const tn::Dictionary* entries = contents->dictionary();
    if (entries == nullptr) continue;
    anyTable = true;
    for (const std::string& key : keys) {
      if (strings.contains(key)) continue;
      if (const tn::Value* value = entries->find(key); value != nullptr && value->isString()) {
        strings.emplace(key, *value->string());
      }
    }
  }
  if (!anyTable) return std::nullopt;
  return strings;
}

void StringsTables::clear() {
  const std::lock_guard lock(mutex_);
  cache_.clear();
}

size_t StringsTables::cachedCount() {
  const std::lock_guard lock(mutex_);
  return cache_.size();
}

}  // namespace registrar
