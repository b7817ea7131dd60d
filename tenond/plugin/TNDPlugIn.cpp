#include "tenond/plugin/TNDPlugIn.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <utility>

#include "platform/value/Date.h"
#include "platform/log/Log.h"
#include "platform/paths/InstancePaths.h"

namespace tnd {
namespace {

constexpr std::string_view kHubProtocolVersionKey = "HubProtocolVersion";
constexpr std::string_view kOldStyleKey = "Tenon";
constexpr std::string_view kPlugInKey = "XTExtension";
constexpr std::string_view kAttributesKey = "XTExtensionAttributes";

tn::Error misconfigured(std::string message) { return tn::TNMakeError(tn::kUnusablePlugInErrorCode, std::move(message)); }

}  // namespace

std::string TNDPlugIn::systemVolumePrefix() {
  return paths::platformRoot() + "/System/";
}

TNDPlugIn::TNDPlugIn(CreateTag, std::shared_ptr<const registrar::Registrar> registrar)
    : registrar_(std::move(registrar)) {}

std::shared_ptr<TNDPlugIn> TNDPlugIn::initWithRGData(const registrar::PlugInPtr& record,
                                                     std::shared_ptr<const registrar::Registrar> registrar,
                                                     const tn::TNRegistryLookup& lookup) {
  if (!record || record->bundlePath().empty()) return nullptr;
  auto plugIn = std::make_shared<TNDPlugIn>(CreateTag(), std::move(registrar));
  if (!plugIn->setupWithName(record->identifier(), record->bundleURL(), tn::Value(), record->plugInDictionary(),
                             record->uuid())) {
    return nullptr;
  }
  plugIn->setPlugInDictionary(record->plugInDictionary());
  // The store's date is a double read from a file: never converted unchecked.
  plugIn->setLastModified(tn::wholeSecondsSince1970(record->registrationDate()).value_or(0));
  plugIn->setOnSystemVolume(record->onSystemPartition());
  plugIn->copyRegistrarFacts(*record, lookup);

  const tn::Value declared = record->plugInDictionary()[kHubProtocolVersionKey];
  if (auto version = declared.uint64()) {
    plugIn->setHubProtocolVersion(*version);
  } else {
    plugIn->setHubProtocolVersion(plugIn->infoKey(kOldStyleKey).isNull() ? 2 : 1);
  }
  if (const auto& app = record->containingApp()) plugIn->setContainingUrl(app->bundleURL());

  if (std::optional<tn::Error> problem = plugIn->diagnose()) {
    TN_LOG_INFO(tn::log::ops(), "ignoring mis-configured plug-in at {}: {}", record->bundlePath(),
                problem->localizedDescription());
    return nullptr;
  }
  return plugIn;
}

void TNDPlugIn::copyRegistrarFacts(const registrar::PlugInRecord& record, const tn::TNRegistryLookup& lookup) {
  setLocalizedName(record.localizedName());
  setLocalizedShortName(record.localizedShortName());
  if (const auto& app = record.containingApp()) setLocalizedContainingName(app->localizedName());
  setLocalizedFileSourceActionNames(tn::Value(tn::localizedFileSourceActionNamesForTNDict(
      lookup, record.bundleURL(), record.plugInDictionary(), record.bundlePath())));
  setOriginalIdentifier(record.originalIdentifier());
  setEntitlements(record.entitlements());
  dataContainerURL_ = record.dataContainerURL();
  infoManifest_.set(record.infoDictionary());
}

registrar::PlugInPtr TNDPlugIn::getProxy() const {
  const std::optional<tn::UUID> id = uuid();
  if (id) {
    if (registrar::PlugInPtr record = registrar_->plugInForUUID(*id)) return record;
  }
  const std::optional<tn::URL> location = url();
  TN_LOG_DEFAULT(tn::log::rg(), "Failed to find Plugin by {} fallback to path {}",
                 id ? id->string() : std::string("(none)"), location ? location->path() : std::string("(none)"));
  if (!location) return nullptr;
  return registrar_->plugInForURL(*location);
}

tn::Value TNDPlugIn::bundleInfoDictionary() const {
  const tn::UUID knowledge = registrar_->knowledgeUUID();
  if (rgKnowledgeUUID_.get() == knowledge) return infoManifest_.get();
  const std::lock_guard lock(refreshMutex_);
  if (registrar::PlugInPtr record = getProxy()) {
    infoManifest_.set(record->infoDictionary());
  } else {
    TN_LOG_ERROR(tn::log::ops(), "could not obtain fresh proxy for {}",
                 uuid() ? uuid()->string() : std::string("(none)"));
    infoManifest_.set(tn::Value());
  }
  rgKnowledgeUUID_.set(knowledge);
  return infoManifest_.get();
}

tn::Value TNDPlugIn::infoKey(std::string_view key) const { return bundleInfoDictionary()[key]; }

tn::Value TNDPlugIn::pluginKey(std::string_view key) const { return infoKey(kPlugInKey)[key]; }

tn::Value TNDPlugIn::attribute(std::string_view key) const { return pluginKey(kAttributesKey)[key]; }

tn::Value TNDPlugIn::valueForEntitlement(std::string_view name) const { return entitlements()[name]; }

bool TNDPlugIn::hasEntitlement(std::string_view name) const {
  const tn::Value value = valueForEntitlement(name);
  if (value.isNull()) return false;
  if (auto flag = value.boolean()) return *flag;
  if (auto number = value.numberAsDouble()) return *number != 0;
  return true;
}

std::string TNDPlugIn::annotationKey() const {
  const tn::Value replaced = valueForEntitlement(kReplacePlugInEntitlement);
  if (const std::string* key = replaced.string()) return *key;
  return identifier().value_or(std::string());
}

std::optional<tn::Error> TNDPlugIn::diagnose() const {
  if (std::optional<tn::Error> shared = TNPlugInCore::diagnose()) return shared;
  if (!isData() && !dataContainerURL()) return misconfigured("this plug-in has no sandbox data container");
  if (!containingUrl() && !path().value_or("").starts_with(systemVolumePrefix())) {
    return misconfigured("plug-ins outside containing apps must be in /System");
  }
  return std::nullopt;
}

tn::Dictionary TNDPlugIn::prunedInfoDictionaryFor(const tn::Dictionary& dictionary) {
  tn::Dictionary pruned;
  for (const auto& [key, value] : dictionary) {
    if (!key.starts_with("DT")) pruned.set(key, value);
  }
  return pruned;
}

}  // namespace tnd
