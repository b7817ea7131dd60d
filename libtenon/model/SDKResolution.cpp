// SDK resolution: merging the SDK dictionary of a plug-in's extension point
// into its bundle information dictionary.

#include "libtenon/model/PlugInKeys.h"
#include "libtenon/model/TNPlugInCore.h"
#include "platform/log/Log.h"

namespace tn {
namespace {

constexpr std::string_view kResolveOperation = "TNPlugInCore::resolveSDK";

// The elements of a "Shared" value: an array's elements, a single value as
// one element, none as no element.
const Value* sharedElements(const Value& shared, size_t& count) {
  if (const Array* elements = shared.array()) {
    count = elements->size();
    return elements->data();
  }
  count = shared.isNull() ? 0 : 1;
  return &shared;
}

void appendDistinct(Array& out, const Value& shared) {
  size_t count = 0;
  const Value* elements = sharedElements(shared, count);
  for (size_t i = 0; i < count; ++i) {
    bool seen = false;
    for (const Value& kept : out) {
      if (kept == elements[i]) {
        seen = true;
        break;
      }
    }
    if (!seen) out.push_back(elements[i]);
  }
}

// The merged value of one key both sides have, by the rules in the order
// they are checked.
Value mergedValue(std::string_view key, const Value& sdkValue, const Value& plugInValue) {
  if (TNPlugInCore::sdkOverridesKey(key)) return sdkValue;
  if (key == keys::kShared) return Value(TNPlugInCore::mergeSharedResources(sdkValue, plugInValue));
  if (sdkValue.isDictionary() && plugInValue.isDictionary()) {
    return Value(TNPlugInCore::mergeDictionary(*sdkValue.dictionary(), *plugInValue.dictionary()));
  }
  // Also where the SDK has a dictionary and the plug-in something else: the
  // plug-in states what it means, so it overrides the SDK (docs/model.md).
  return plugInValue;
}

}  // namespace

bool TNPlugInCore::sdkOverridesKey(std::string_view key) { return key == keys::kCleanTimeout; }

Array TNPlugInCore::mergeSharedResources(const Value& sdkShared, const Value& plugInShared) {
  Array merged;
  appendDistinct(merged, plugInShared);
  appendDistinct(merged, sdkShared);
  return merged;
}

Dictionary TNPlugInCore::mergeDictionary(const Dictionary& sdk, const Dictionary& plugIn) {
  Dictionary merged = plugIn;
  for (const auto& [key, sdkValue] : sdk) {
    const Value* plugInValue = plugIn.find(key);
    merged.set(key, plugInValue ? mergedValue(key, sdkValue, *plugInValue) : sdkValue);
  }
  return merged;
}

std::optional<Dictionary> TNPlugInCore::readSDKDictionary(std::string_view identifier,
                                                          const TNRegistryLookup& registry) {
  std::optional<Dictionary> sdk = registry.sdkDictionary(identifier);
  if (!sdk) TN_LOG_DEFAULT(log::ops(), "plug-in sdk \"{}\" not registered", identifier);
  return sdk;
}

void TNPlugInCore::resolveSDK(const TNRegistryLookup& registry) {
  const Value bundleInfo = bundleInfoDictionary();
  if (!bundleInfo.isDictionary()) {
    // A caller's fault: reported, and nothing is changed, since there is
    // nothing to merge into.
    TN_LOG_ERROR(log::ops(), "TNPlugInCore: cannot resolve SDK without materialized Info.manifest");
    return;
  }
  const Value spec = sdkSpec();
  if (!spec.isNull() && !spec.isString()) {
    TN_LOG_ERROR(log::ops(), "invalid SDK key:{}", spec);
    return;
  }
  if (const std::string* identifier = spec.string()) {
    if (std::optional<Dictionary> sdk = readSDKDictionary(*identifier, registry)) {
      const Value merged(mergeDictionary(*sdk, *bundleInfo.dictionary()));
      (void)setDictionaries(merged);
      TN_LOG_DEBUG(log::rg(), "{} {} merged with SDK", kResolveOperation, merged[keys::kBundleDisplayName]);
    }
  }
  canonicalize();
}

}  // namespace tn
