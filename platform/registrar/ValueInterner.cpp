#include "platform/registrar/ValueInterner.h"

#include <cstring>
#include <vector>

namespace registrar {
namespace {

template <typename T>
void appendBytes(std::string& key, const T& value) {
  char bytes[sizeof(T)];
  std::memcpy(bytes, &value, sizeof(T));
  key.append(bytes, sizeof(T));
}

// What tells an interned value apart from every other: its kind and, for
// the shared kinds (strings, arrays, dictionaries: interned already, so
// equal ones are one object), the address of its storage; for the others
// their bits. Two containers whose entries give the same tokens, in the
// same order, are identical.
void appendToken(std::string& key, const tn::Value& value) {
  key.push_back(static_cast<char>(value.kind()));
  switch (value.kind()) {
    case tn::Value::Kind::Null: break;
    case tn::Value::Kind::Bool: key.push_back(*value.boolean() ? 1 : 0); break;
    case tn::Value::Kind::Int: appendBytes(key, *value.int64()); break;
    case tn::Value::Kind::UInt: appendBytes(key, *value.uint64()); break;
    case tn::Value::Kind::Double: appendBytes(key, *value.real()); break;
    case tn::Value::Kind::Date: appendBytes(key, value.date()->secondsSince1970); break;
    case tn::Value::Kind::UUID: key.append(reinterpret_cast<const char*>(value.uuid()->bytes().data()), 16); break;
    case tn::Value::Kind::String: appendBytes(key, value.string()); break;
    case tn::Value::Kind::Array: appendBytes(key, value.array()); break;
    case tn::Value::Kind::Dictionary: appendBytes(key, value.dictionary()); break;
    case tn::Value::Kind::Data:
      appendBytes(key, value.data()->size());
      key.append(reinterpret_cast<const char*>(value.data()->data()), value.data()->size());
      break;
  }
}

}  // namespace

tn::Value ValueInterner::intern(const tn::Value& value) {
  if (const std::string* text = value.string()) {
    if (const auto found = strings_.find(*text); found != strings_.end()) return found->second;
    return strings_.emplace(std::string_view(*text), value).first->second;  // value keeps *text alive
  }
  const tn::Dictionary* dictionary = value.dictionary();
  const tn::Array* array = value.array();
  if (dictionary == nullptr && array == nullptr) return value;  // numbers and the like: nothing shared

  // The children first, so that the container's key is made of their tokens.
  std::vector<tn::Value> children;
  std::string key(1, dictionary != nullptr ? 'D' : 'A');
  children.reserve(dictionary != nullptr ? dictionary->size() : array->size());
  const auto addChild = [&](const tn::Value& child) {
    children.push_back(intern(child));
    appendToken(key, children.back());
  };
  if (dictionary != nullptr) {
    for (const auto& [entryKey, entryValue] : *dictionary) {
      appendBytes(key, entryKey.size());
      key += entryKey;
      addChild(entryValue);
    }
  } else {
    for (const tn::Value& element : *array) addChild(element);
  }
  if (const auto found = containers_.find(key); found != containers_.end()) return found->second;

  tn::Value shared;
  if (dictionary != nullptr) {
    tn::Dictionary rebuilt;
    rebuilt.reserve(children.size());
    size_t i = 0;
    for (const auto& entry : *dictionary) rebuilt.insertNew(entry.first, std::move(children[i++]));
    shared = tn::Value(std::move(rebuilt));
  } else {
    shared = tn::Value(tn::Array(std::make_move_iterator(children.begin()), std::make_move_iterator(children.end())));
  }
  return containers_.emplace(std::move(key), std::move(shared)).first->second;
}

}  // namespace registrar
