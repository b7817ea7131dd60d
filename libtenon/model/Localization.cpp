// Localization: the localized titles of a file-source plug-in's actions, and
// a record's localized view of its bundle information dictionary.

#include <set>

#include "libtenon/model/PlugInKeys.h"
#include "libtenon/model/TNPlugInCore.h"
#include "platform/log/Log.h"

namespace tn {
namespace {

// The kinds the platform archives securely; only the value's own kind is
// tested, not the contents of a container. UUIDs are not among them.
bool isSecurelyArchivable(const Value& value) {
  switch (value.kind()) {
    case Value::Kind::Bool:
    case Value::Kind::Int:
    case Value::Kind::UInt:
    case Value::Kind::Double:
    case Value::Kind::String:
    case Value::Kind::Data:
    case Value::Kind::Date:
    case Value::Kind::Array:
    case Value::Kind::Dictionary:
      return true;
    case Value::Kind::Null:
    case Value::Kind::UUID:
      return false;
  }
  return false;
}

// The value a localized info dictionary holds for key; null to leave it out.
Value localizedValue(const TNPlugInCore& record, const Value& bundleInfo, const std::string& key) {
  std::optional<std::string> localized;
  if (key == keys::kBundleName) localized = record.localizedShortName();
  if (key == keys::kBundleDisplayName) localized = record.localizedName();
  if (localized) return Value(*localized);
  Value value = record.infoKey(key);
  return value.isNull() ? bundleInfo[key] : value;
}

}  // namespace

void TNPlugInCore::localizedInfoDictionaryForKeys(const std::vector<std::string>& keysWanted,
                                                  const LocalizedInfoCompletion& completion) const {
  const auto finish = [&completion](std::optional<Dictionary> result, std::optional<Error> error) {
    TN_LOG_DEBUG(log::rg(), "localized values {}", result ? Value(*result) : Value());
    completion(std::move(result), std::move(error));
  };
  const Value bundleInfo = bundleInfoDictionary();
  const std::string name = identifier().value_or("(null)");
  if (bundleInfo.isNull()) {
    return finish(std::nullopt, TNMakeErrorWithFormat(kLocalizedInfoErrorCode, "Unable to resolve plugin for {}", name));
  }
  Dictionary result;
  for (const std::string& key : keysWanted) {
    Value value = localizedValue(*this, bundleInfo, key);
    if (value.isNull()) continue;
    if (!isSecurelyArchivable(value)) {
      return finish(std::nullopt,
                    TNMakeErrorWithFormat(kLocalizedInfoErrorCode,
                                          "Value of info dictionary key \"{}\" for plugin {} does not conform to "
                                          "secure coding!",
                                          key, name));
    }
    result.set(key, std::move(value));
  }
  finish(std::move(result), std::nullopt);
}

Dictionary localizedFileSourceActionNamesForTNDict(const TNRegistryLookup& registry, const URL& plugInBundle,
                                                   const Value& plugInDictionary, std::string_view plugInDescription) {
  std::vector<std::string> names;  // in order of first appearance
  std::set<std::string, std::less<>> distinct;
  if (const Array* actions = plugInDictionary[keys::kFileSourceActions].array()) {
    for (const Value& action : *actions) {
      // An element that is not a dictionary has no name either.
      const std::string* name = action[keys::kFileSourceActionName].string();
      if (!name) {
        TN_LOG_ERROR(log::rg(), "missing XTExtensionFileSourceActionName for plugin {}", plugInDescription);
        continue;
      }
      if (distinct.insert(*name).second) names.push_back(*name);
    }
  }
  Dictionary result;
  if (names.empty()) return result;
  const std::optional<TNRegistryLookup::LocalizedStrings> strings =
      registry.localizedStrings(plugInBundle, keys::kLocalizableTable, distinct);
  for (const std::string& name : names) {
    std::string title = name;
    if (strings) {
      if (const auto found = strings->find(name); found != strings->end()) title = found->second;
    }
    result.set(name, Value(std::move(title)));
  }
  return result;
}

}  // namespace tn
