#include "platform/value/MessageValue.h"

namespace tn {
namespace {

// The value under key, or nullptr; a non-dictionary message has no keys.
const Value* lookup(const Value& message, const char* key) {
  const Dictionary* dictionary = message.dictionary();
  return dictionary ? dictionary->find(key) : nullptr;
}

// The plain conversion is the same in both directions: a copy without null
// elements.
Value withoutNulls(const Value& value) {
  if (const Array* array = value.array()) {
    Array copy;
    copy.reserve(array->size());
    for (const Value& element : *array)
      if (!element.isNull()) copy.push_back(withoutNulls(element));
    return Value(std::move(copy));
  }
  if (const Dictionary* dictionary = value.dictionary()) {
    Dictionary copy;
    copy.reserve(dictionary->size());
    for (const auto& [key, element] : *dictionary)
      if (!element.isNull()) copy.insertNew(key, withoutNulls(element));
    return Value(std::move(copy));
  }
  return value;
}

}  // namespace

const Array* relay_dictionary_get_array(const Value& message, const char* key) {
  const Value* v = lookup(message, key);
  return v ? v->array() : nullptr;
}

const Dictionary* relay_dictionary_get_dictionary(const Value& message, const char* key) {
  const Value* v = lookup(message, key);
  return v ? v->dictionary() : nullptr;
}

const std::string* relay_dictionary_get_string(const Value& message, const char* key) {
  const Value* v = lookup(message, key);
  return v ? v->string() : nullptr;
}

const Bytes* relay_dictionary_get_data(const Value& message, const char* key) {
  const Value* v = lookup(message, key);
  return v ? v->data() : nullptr;
}

std::optional<uint64_t> relay_dictionary_get_uint64(const Value& message, const char* key) {
  const Value* v = lookup(message, key);
  return v ? v->uint64() : std::nullopt;
}

std::optional<int64_t> relay_dictionary_get_int64(const Value& message, const char* key) {
  const Value* v = lookup(message, key);
  return v ? v->int64() : std::nullopt;
}

std::optional<bool> relay_dictionary_get_bool(const Value& message, const char* key) {
  const Value* v = lookup(message, key);
  return v ? v->boolean() : std::nullopt;
}

std::optional<UUID> relay_dictionary_get_uuid(const Value& message, const char* key) {
  const Value* v = lookup(message, key);
  return v ? v->uuid() : std::nullopt;
}

Value convertMessageToMemory(const Value& message) { return withoutNulls(message); }

Value convertMemoryToMessage(const Value& value) { return withoutNulls(value); }

}  // namespace tn
