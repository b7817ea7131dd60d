#include "libtenon/model/TNPlugInCore.h"

#include <cassert>

#include "libtenon/model/PlugInKeys.h"
#include "libtenon/model/SmallDictionaryChanges.h"
#include "platform/log/Log.h"

namespace tn {
namespace {

// The operation names that log lines carry ("%s" in the design).
constexpr std::string_view kSetupOperation = "TNPlugInCore::setupWithName";
constexpr std::string_view kSetDictionariesOperation = "TNPlugInCore::setDictionaries";
constexpr std::string_view kInfoKeyOperation = "TNPlugInCore::infoKey";

// The boolean value of a plug-in key: true, or a non-zero number.
bool boolValue(const Value& value) {
  if (std::optional<bool> flag = value.boolean()) return *flag;
  if (std::optional<double> number = value.numberAsDouble()) return *number != 0;
  return false;
}

std::string_view withoutTrailingSlashes(std::string_view path) {
  while (path.size() > 1 && path.back() == '/') path.remove_suffix(1);
  return path;
}

Error diagnosis(std::string message) { return TNMakeError(kUnusablePlugInErrorCode, std::move(message)); }

}  // namespace

std::shared_ptr<TNPlugInCore> TNPlugInCore::create(const std::optional<std::string>& identifier,
                                                   const std::optional<URL>& url, const Value& bundleInfo,
                                                   const Value& info, const std::optional<UUID>& uuid) {
  auto record = std::make_shared<TNPlugInCore>();
  if (!record->setupWithName(identifier, url, bundleInfo, info, uuid)) return nullptr;
  if (record->plugInDictionary().isNull()) record->setPlugInDictionary(info);
  return record;
}

bool TNPlugInCore::setupWithName(const std::optional<std::string>& identifier, const std::optional<URL>& url,
                                 const Value& bundleInfo, const Value& /*info*/, const std::optional<UUID>& uuid) {
  if (!url) return false;
  if (!identifier) {
    TN_LOG_ERROR(log::ops(), "missing identifier in plug-in at {}", url->path());
    return false;
  }
  if (!bundleInfo.isNull()) {
    const Value normalized = normalizeInfoDictionary(bundleInfo);
    if (!setDictionaries(normalized)) {
      TN_LOG_DEFAULT(log::ops(), "malformed plug-in dictionary in plug-in {} at {}: {}", *identifier, *url, normalized);
      return false;
    }
    TN_LOG_DEBUG(log::rg(), "{} {}", kSetupOperation, normalized[keys::kBundleDisplayName]);
  }
  setIdentifier(identifier);
  setUrl(url);
  setUuid(uuid ? *uuid : UUID::random());
  return true;
}

bool TNPlugInCore::setDictionaries(const Value& bundleInfo) {
  if (!bundleInfo.isDictionary()) return false;
  setBundleInfoDictionary(bundleInfo);
  TN_LOG_DEBUG(log::ops(), "{} {}", kSetDictionariesOperation, bundleInfo[keys::kBundleDisplayName]);
  const Value& plugIn = bundleInfo[keys::kXTExtension];
  if (!plugIn.isDictionary()) return false;
  setPlugInDictionary(plugIn);
  if (plugIn.dictionary()->contains(keys::kMultiple)) {
    TN_LOG_DEFAULT(log::ops(), "multiplexed plug-ins ({} key) obsolete and ignored", keys::kMultiple);
  }
  return true;
}

Value TNPlugInCore::normalizeInfoDictionary(const Value& bundleInfo) const { return bundleInfo; }

std::optional<std::string> TNPlugInCore::path() const {
  const std::optional<URL> location = url();
  if (!location) return std::nullopt;
  return location->path();
}

std::optional<std::string> TNPlugInCore::containingPath() const {
  const std::optional<URL> location = containingUrl();
  if (!location) return std::nullopt;
  return location->path();
}

Value TNPlugInCore::attributes() const { return pluginKey(keys::kAttributes); }

Value TNPlugInCore::version() const { return attribute(keys::kVersion); }

Value TNPlugInCore::protocolSpec() const {
  Value spec = pluginKey(keys::kProtocol);
  if (spec.isNull() && isAppExtension()) return Value(keys::kDefaultObject);
  return spec;
}

Value TNPlugInCore::principalSpec() const {
  Value spec = pluginKey(keys::kPrincipalClass);
  if (spec.isNull() && isAppExtension()) return Value(keys::kDefaultObject);
  return spec;
}

Value TNPlugInCore::sdkSpec() const { return pluginKey(keys::kExtensionPointIdentifier); }

Value TNPlugInCore::embeddedProtocolSpec() const {
  Value spec = pluginKey(keys::kEmbeddedProtocol);
  return spec.isNull() ? protocolSpec() : spec;
}

bool TNPlugInCore::isAppExtension() const {
  const std::optional<std::string> location = path();
  return location && withoutTrailingSlashes(*location).ends_with(keys::kAppExtensionSuffix);
}

bool TNPlugInCore::isHybrid() const { return !pluginKey(keys::kEmbeddedCode).isNull(); }

bool TNPlugInCore::isDedicated() const { return boolValue(pluginKey(keys::kDedicated)); }

bool TNPlugInCore::isData() const {
  const Value spec = protocolSpec();
  return spec.string() && *spec.string() == keys::kDataProtocol;
}

Date TNPlugInCore::timestamp() const { return Date{static_cast<double>(lastModified())}; }

bool TNPlugInCore::oldStyle() const {
  if (!infoKey(keys::kXTExtension).isNull()) return false;
  if (!infoKey(keys::kTenon).isNull()) return true;
  // The record was built from dictionaries of neither style: a fault of
  // whoever built it, reported but not fatal, since a client cannot repair it.
  TN_LOG_ERROR(log::ops(), "TNPlugInCore: internal inconsistency: unknown plug-in configuration style");
  return true;
}

Value TNPlugInCore::infoKey(std::string_view key) const {
  const Value bundleInfo = bundleInfoDictionary();
  Value value = bundleInfo[key];
  TN_LOG_DEBUG(log::rg(), "{} {} => {}", kInfoKeyOperation, key, value);
  return value;
}

Value TNPlugInCore::pluginKey(std::string_view key) const { return plugInDictionary()[key]; }

Value TNPlugInCore::attribute(std::string_view key) const { return attributes()[key]; }

Value TNPlugInCore::augmentInterface(const Value& /*interface*/) const { return Value(); }

bool TNPlugInCore::isEqual(const TNPlugInCore* other) const {
  if (other == nullptr) return false;
  const std::optional<UUID> mine = uuid();
  assert(mine && "self.uuid");
  return mine && mine == other->uuid();
}

size_t TNPlugInCore::hash() const {
  const std::optional<UUID> mine = uuid();
  assert(mine && "self.uuid");
  return mine ? std::hash<UUID>()(*mine) : 0;
}

void TNPlugInCore::setAnnotation(std::string_view key, const std::optional<Value>& value) {
  const Value current = annotations();
  const Dictionary* existing = current.dictionary();
  setAnnotations(Value(dictionaryChanging(existing ? *existing : Dictionary(), key, value)));
}

std::optional<Error> TNPlugInCore::diagnose() const {
  if (!identifier()) return diagnosis("missing identifier (no XTExtensionIdentifier, nor even BNBundleIdentifier)");
  if (protocolSpec().isNull()) {
    return diagnosis(fmt::format("missing \"{}\" key in Info.manifest or SDK", keys::kProtocol));
  }
  // An attributes value that is not a dictionary holds no attribute a rule
  // could match, so it counts as missing.
  if (!attributes().isDictionary()) {
    return diagnosis(fmt::format("missing \"{}\" key in Info.manifest or SDK", keys::kAttributes));
  }
  if (isAppExtension()) {
    const Value principal = principalSpec();
    if (!principal.string() || *principal.string() != keys::kDefaultObject) {
      return diagnosis(fmt::format("Application Extensions may not use the \"{}\" key", keys::kPrincipalClass));
    }
  }
  if (!pluginKey(keys::kPassProxy).isNull()) {
    return diagnosis(fmt::format("the \"{}\" key is not supported on this platform", keys::kPassProxy));
  }
  if (isHybrid()) return diagnosis("hybrid plug-ins are not supported on this platform");
  return std::nullopt;
}

}  // namespace tn
