#pragma once

// The keys of a plug-in's Info.manifest that the system reads, where each
// belongs and the kind of value it must have (tenon-bundle(5) documents
// them for authors). Lint checks manifests against this table.

#include <span>
#include <string_view>

#include "platform/value/Value.h"

namespace tnctl {

enum class ValueKind {
  String,
  Flag,        // a boolean, or a number read as one (0 is false)
  Number,
  Dictionary,
  Strings,     // a string, or an array of strings
  Actions,     // an array of dictionaries (file source actions)
  Rule,        // an activation rule (any kind; its structure is checked)
  Any,         // read for its presence only
};

enum class KeyPlace {
  Info,        // the top level of Info.manifest
  PlugIn,      // the "XTExtension" dictionary
  Attributes,  // the "XTExtensionAttributes" dictionary (reserved keys only)
};

struct KnownKey {
  std::string_view key;
  KeyPlace place;
  ValueKind kind;
};

std::span<const KnownKey> knownKeys();

// The known keys of one place, for suggestions.
std::span<const std::string_view> knownKeyNames(KeyPlace place);

// "a string", "a dictionary", … for messages.
std::string_view kindName(ValueKind kind);
// "an array", "a number", … : what the value is.
std::string_view valueKindName(const tn::Value& value);
// Whether `value` is of `kind` (a Rule's structure is checked elsewhere).
bool hasKind(const tn::Value& value, ValueKind kind);

// "Info.manifest", "XTExtension", "XTExtensionAttributes".
std::string_view placeName(KeyPlace place);

}  // namespace tnctl
