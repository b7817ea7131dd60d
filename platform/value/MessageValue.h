#pragma once

// Message values: the dictionaries requests and replies are made of. On this
// system they ARE tn::Value (the wire decodes straight into them), so this
// header only adds the typed reads the request handlers use, and the plain
// conversions between message values and the values the daemon keeps in
// memory.

#include <cstdint>
#include <optional>
#include <string>

#include "platform/value/UUID.h"
#include "platform/value/Value.h"

namespace tn {

// Typed reads of one key of a message dictionary. Each answers none (nullptr
// or nullopt) when the message is not a dictionary, the key is absent, or it
// holds another kind; callers never need to tell these apart. Pointers point
// into the message and remain valid as long as the message value (or any copy
// sharing its payload) is alive; nothing is copied.
const Array* relay_dictionary_get_array(const Value& message, const char* key);
const Dictionary* relay_dictionary_get_dictionary(const Value& message, const char* key);
const std::string* relay_dictionary_get_string(const Value& message, const char* key);
const Bytes* relay_dictionary_get_data(const Value& message, const char* key);
// A uint64, or a non-negative int64.
std::optional<uint64_t> relay_dictionary_get_uint64(const Value& message, const char* key);
// An int64, or a uint64 no larger than INT64_MAX (the wire carries every
// non-negative integer as unsigned).
std::optional<int64_t> relay_dictionary_get_int64(const Value& message, const char* key);
std::optional<bool> relay_dictionary_get_bool(const Value& message, const char* key);
std::optional<UUID> relay_dictionary_get_uuid(const Value& message, const char* key);

// Plain conversions between a message value and an in-memory value. Every
// kind maps to itself, recursively (booleans stay booleans, integers keep
// their kind). Null is the one kind without a counterpart on either side: a
// null value converts to a null Value ("none"), and a null element inside an
// array or dictionary is dropped while the container keeps its other
// elements (a dictionary loses that key; containers that end up empty stay).
// The result is a new value owned by the caller; scalar payloads are shared,
// which is safe because values are immutable.
Value convertMessageToMemory(const Value& message);
Value convertMemoryToMessage(const Value& value);

}  // namespace tn
