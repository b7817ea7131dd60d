#pragma once

// ValueInterner: makes equal values share one immutable storage.
//
// Ten thousand plug-ins repeat the same strings ("1.0", extension point
// identifiers, protocols) and often whole dictionaries ("XTExtension" of
// plug-ins of one kind, empty entitlements and localizations). Loading the
// store decodes every row on its own; passing each value through one
// interner leaves one copy of each distinct string, array and dictionary,
// shared by every record that holds it (values never change, so sharing is
// invisible). Equal means identical (tn::Value::identical: same types, same
// order of keys): a container is looked up by its keys and its interned
// children's identities, built bottom-up, so nothing is encoded or walked
// twice.
//
// For one load: the tables hold a copy of everything seen, and go with the
// interner.

#include <string>
#include <string_view>
#include <unordered_map>

#include "platform/value/Value.h"

namespace registrar {

class ValueInterner {
 public:
  // The value identical to value handed out first, sharing its storage;
  // its arrays and dictionaries hold interned values in turn.
  tn::Value intern(const tn::Value& value);

 private:
  // Keyed by a view of the kept value's own text: no copy.
  std::unordered_map<std::string_view, tn::Value> strings_;
  // By keys and children's tokens; the values kept here keep the addresses
  // those tokens name alive for as long as the interner.
  std::unordered_map<std::string, tn::Value> containers_;
};

}  // namespace registrar
