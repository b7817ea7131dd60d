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
// order of keys): the typed CBOR encoding is the key.
//
// For one load: the tables hold a copy of everything seen, and go with the
// interner.

#include <string>
#include <unordered_map>

#include "platform/value/Value.h"

namespace registrar {

class ValueInterner {
 public:
  // The value identical to value handed out first, sharing its storage;
  // its arrays and dictionaries hold interned values in turn.
  tn::Value intern(const tn::Value& value);

 private:
  std::unordered_map<std::string, tn::Value> strings_;
  std::unordered_map<std::string, tn::Value> containers_;  // by typed CBOR encoding
};

}  // namespace registrar
