#include "platform/registrar/ValueInterner.h"

#include "platform/value/Cbor.h"

namespace registrar {

tn::Value ValueInterner::intern(const tn::Value& value) {
  if (const std::string* text = value.string()) return strings_.try_emplace(*text, value).first->second;
  const tn::Dictionary* dictionary = value.dictionary();
  const tn::Array* array = value.array();
  if (dictionary == nullptr && array == nullptr) return value;  // numbers and the like: nothing shared

  const tn::Bytes encoded = tn::encodeCbor(value, tn::CborDialect::Typed);
  std::string key(encoded.begin(), encoded.end());
  if (const auto found = containers_.find(key); found != containers_.end()) return found->second;
  tn::Value shared;
  if (dictionary != nullptr) {
    tn::Dictionary rebuilt;
    rebuilt.reserve(dictionary->size());
    for (const auto& [entryKey, entryValue] : *dictionary) rebuilt.insertNew(entryKey, intern(entryValue));
    shared = tn::Value(std::move(rebuilt));
  } else {
    tn::Array rebuilt;
    rebuilt.reserve(array->size());
    for (const tn::Value& element : *array) rebuilt.push_back(intern(element));
    shared = tn::Value(std::move(rebuilt));
  }
  return containers_.emplace(std::move(key), std::move(shared)).first->second;
}

}  // namespace registrar
