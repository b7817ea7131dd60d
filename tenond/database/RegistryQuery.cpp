// TNDatabase::findPlugIns: the discovery query. The registrar selects the
// installed plug-ins that may satisfy the host's rules (it leaves out only
// what the rules certainly refuse, using its identifier index where it
// can); the database adds the user's election as a filter, skips records it
// cannot use, and hands back cached plug-ins. The discovery request then
// matches every candidate against the rules exactly.

#include <algorithm>
#include <unordered_set>

#include "platform/log/Log.h"
#include "tenond/database/ElectionFilter.h"
#include "tenond/database/TNDatabase.h"

namespace tnd {
namespace {

std::string describe(const registrar::PlugInList& records) {
  std::string text = "(";
  for (const registrar::PlugInPtr& record : records) {
    if (text.size() > 1) text += ", ";
    text += record->identifier() + " " + record->uuid().string();
  }
  return text + ")";
}

}  // namespace

std::optional<registrar::PlugInList> TNDatabase::queryRegistrar(const tn::Value& rules) {
  const tn::Dictionary* entries = rules.dictionary();
  if (entries == nullptr || entries->empty()) {
    registrar::PlugInList all = workspace_->installedPlugIns();
    TN_LOG_DEBUG(tn::log::rg(), "{} installedPlugins: {}", all.size(), describe(all));
    return all;
  }
  const std::optional<ElectionFilter> elections = electionFilterOf(rules);
  std::optional<registrar::PlugInList> found = workspace_->queryPlugIns(
      rules, [&](const std::string& identifier, const tn::Value& entitlements) {
        if (!elections) return true;
        const std::string key = annotationKeyOf(identifier, entitlements);
        // The store belongs to the database queue.
        const tn::Value stored = sync_->sync([&]() -> tn::Value {
          const std::optional<tn::Dictionary> annotation = annotations_->annotationForIdentifier(key);
          return annotation ? annotation->get("election") : tn::Value();
        });
        const std::string election = candidateElection(stored, entitlements);
        const bool keep = std::find(elections->begin(), elections->end(), election) != elections->end();
        TN_LOG_DEBUG(tn::log::ops(), "rg filter {} -> {}", key, keep ? 1 : 0);
        return keep;
      });
  TN_LOG_DEBUG(tn::log::rg(), "{} plugin(s) matching {} = {}", found ? found->size() : 0, rules,
               found ? describe(*found) : std::string("(null)"));
  return found;
}

std::optional<std::vector<std::shared_ptr<TNDPlugIn>>> TNDatabase::findPlugIns(const tn::Value& rules) {
  const std::optional<registrar::PlugInList> records = queryRegistrar(rules);
  const size_t cachedBefore = cacheCount();
  if (!records) return std::nullopt;
  std::vector<std::shared_ptr<TNDPlugIn>> found;
  std::unordered_set<const TNDPlugIn*> seen;
  for (const registrar::PlugInPtr& record : *records) {
    if (record->bundlePath().empty()) {
      TN_LOG_INFO(tn::log::ops(), "skipping rg proxy {} with nil bundleURL", record->uuid().string());
      continue;
    }
    // The registrar's records name their containing application by type,
    // so a containing bundle that is not an application cannot occur.
    if (const registrar::AppPtr& app = record->containingApp(); app && app->isPlaceholder()) {
      TN_LOG_INFO(tn::log::ops(), "skipping rg proxy {} because its app is a placeholder", record->bundlePath());
      continue;
    }
    std::shared_ptr<TNDPlugIn> plugIn = plugInForProxy(record);
    if (plugIn && seen.insert(plugIn.get()).second) found.push_back(std::move(plugIn));
  }
  TN_LOG_DEBUG(tn::log::ops(), "RG reported {} plug-ins (cache {}/{})", found.size(), cachedBefore, cacheCount());
  return found;
}

}  // namespace tnd
