#include "tools/tnctl/ManifestSchema.h"

#include <algorithm>
#include <array>
#include <vector>

#include "libtenon/model/PlugInKeys.h"
#include "platform/bundle/BundleLayout.h"

namespace tnctl {
namespace {

namespace keys = tn::keys;

constexpr std::array kKnownKeys{
    // Info.manifest
    KnownKey{keys::kBundleIdentifier, KeyPlace::Info, ValueKind::String},
    KnownKey{"BNBundleVersion", KeyPlace::Info, ValueKind::String},
    KnownKey{keys::kBundleShortVersionString, KeyPlace::Info, ValueKind::String},
    KnownKey{keys::kBundleDisplayName, KeyPlace::Info, ValueKind::String},
    KnownKey{keys::kBundleName, KeyPlace::Info, ValueKind::String},
    KnownKey{bundle::kBundleExecutableKey, KeyPlace::Info, ValueKind::String},
    KnownKey{"BNBundlePackageType", KeyPlace::Info, ValueKind::String},
    KnownKey{"RelayService", KeyPlace::Info, ValueKind::Dictionary},
    KnownKey{keys::kXTExtension, KeyPlace::Info, ValueKind::Dictionary},
    KnownKey{keys::kTenon, KeyPlace::Info, ValueKind::Any},
    // XTExtension
    KnownKey{keys::kIdentifier, KeyPlace::PlugIn, ValueKind::String},
    KnownKey{keys::kExtensionPointIdentifier, KeyPlace::PlugIn, ValueKind::String},
    KnownKey{keys::kProtocol, KeyPlace::PlugIn, ValueKind::String},
    KnownKey{keys::kAttributes, KeyPlace::PlugIn, ValueKind::Dictionary},
    KnownKey{keys::kPrincipalClass, KeyPlace::PlugIn, ValueKind::String},
    KnownKey{keys::kEmbeddedProtocol, KeyPlace::PlugIn, ValueKind::String},
    KnownKey{keys::kEmbeddedCode, KeyPlace::PlugIn, ValueKind::Any},
    KnownKey{keys::kDedicated, KeyPlace::PlugIn, ValueKind::Flag},
    KnownKey{keys::kPassProxy, KeyPlace::PlugIn, ValueKind::Any},
    KnownKey{keys::kMultiple, KeyPlace::PlugIn, ValueKind::Any},
    KnownKey{keys::kHubProtocolVersion, KeyPlace::PlugIn, ValueKind::Number},
    KnownKey{keys::kShared, KeyPlace::PlugIn, ValueKind::Strings},
    KnownKey{keys::kCleanTimeout, KeyPlace::PlugIn, ValueKind::Number},
    KnownKey{keys::kFileSourceActions, KeyPlace::PlugIn, ValueKind::Actions},
    KnownKey{"XTExtensionHostEntitlement", KeyPlace::PlugIn, ValueKind::String},
    // XTExtensionAttributes: the keys with a meaning of their own; any
    // other attribute is the author's, for hosts' rules.
    KnownKey{keys::kVersion, KeyPlace::Attributes, ValueKind::String},
    KnownKey{"RequestsOpenAccess", KeyPlace::Attributes, ValueKind::Flag},
    KnownKey{"XTExtensionActivationRule", KeyPlace::Attributes, ValueKind::Rule},
};

std::vector<std::string_view> namesOf(KeyPlace place) {
  std::vector<std::string_view> names;
  for (const KnownKey& known : kKnownKeys) {
    if (known.place == place) names.push_back(known.key);
  }
  return names;
}

}  // namespace

std::span<const KnownKey> knownKeys() { return kKnownKeys; }

std::span<const std::string_view> knownKeyNames(KeyPlace place) {
  static const std::vector<std::string_view> info = namesOf(KeyPlace::Info);
  static const std::vector<std::string_view> plugIn = namesOf(KeyPlace::PlugIn);
  static const std::vector<std::string_view> attributes = namesOf(KeyPlace::Attributes);
  switch (place) {
    case KeyPlace::Info: return info;
    case KeyPlace::PlugIn: return plugIn;
    case KeyPlace::Attributes: return attributes;
  }
  return {};
}

std::string_view kindName(ValueKind kind) {
  switch (kind) {
    case ValueKind::String: return "a string";
    case ValueKind::Flag: return "a boolean";
    case ValueKind::Number: return "a number";
    case ValueKind::Dictionary: return "a dictionary";
    case ValueKind::Strings: return "a string or an array of strings";
    case ValueKind::Actions: return "an array of dictionaries";
    case ValueKind::Rule: return "an activation rule";
    case ValueKind::Any: return "any value";
  }
  return "?";
}

std::string_view valueKindName(const tn::Value& value) {
  switch (value.kind()) {
    case tn::Value::Kind::Null: return "null";
    case tn::Value::Kind::Bool: return "a boolean";
    case tn::Value::Kind::Int:
    case tn::Value::Kind::UInt:
    case tn::Value::Kind::Double: return "a number";
    case tn::Value::Kind::String: return "a string";
    case tn::Value::Kind::Data: return "data";
    case tn::Value::Kind::Date: return "a date";
    case tn::Value::Kind::UUID: return "a UUID";
    case tn::Value::Kind::Array: return "an array";
    case tn::Value::Kind::Dictionary: return "a dictionary";
  }
  return "?";
}

bool hasKind(const tn::Value& value, ValueKind kind) {
  const bool number = value.numberAsDouble().has_value() && !value.boolean().has_value();
  switch (kind) {
    case ValueKind::String: return value.isString();
    case ValueKind::Flag: return value.boolean().has_value() || number;
    case ValueKind::Number: return number;
    case ValueKind::Dictionary: return value.isDictionary();
    case ValueKind::Strings:
      if (value.isString()) return true;
      return value.array() && std::ranges::all_of(*value.array(), [](const tn::Value& e) { return e.isString(); });
    case ValueKind::Actions:
      return value.array() && std::ranges::all_of(*value.array(), [](const tn::Value& e) { return e.isDictionary(); });
    case ValueKind::Rule:
    case ValueKind::Any: return true;
  }
  return false;
}

std::string_view placeName(KeyPlace place) {
  switch (place) {
    case KeyPlace::Info: return "Info.manifest";
    case KeyPlace::PlugIn: return keys::kXTExtension;
    case KeyPlace::Attributes: return keys::kAttributes;
  }
  return "?";
}

}  // namespace tnctl
