#pragma once

// platform/value: the structured values of the system.
//
// tn::Value is the one structured value used for requests and replies on the
// wire, bundle information dictionaries, plug-in forms, annotations, rules and
// documents. Its kinds: null, bool, signed and unsigned 64-bit integers,
// double, string (UTF-8), data (bytes), date, UUID, array and dictionary.
//
// Values are immutable and cheap to copy: strings, data, arrays and
// dictionaries are shared payloads, so passing a request's dictionary around
// costs a reference count. Build a container as a tn::Array or tn::Dictionary
// and wrap it in a Value when it is complete; edit an existing one with
// editArray()/editDictionary(), which copy the payload first when it is shared.
//
// Two equalities: operator== compares numbers by value across kinds
// (1 == true == 1.0, as the system compares numbers) and dictionaries
// regardless of order; identical() also demands the same kind everywhere,
// which is what round trips through an encoding must preserve.

#include <concepts>
#include <cstdint>
#include <initializer_list>
#include <memory>
#include <optional>
#include <ostream>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include <fmt/format.h>

#include "platform/value/Date.h"
#include "platform/value/UUID.h"

namespace tn {

class Value;
class Dictionary;
using Array = std::vector<Value>;
using Bytes = std::vector<uint8_t>;

class Value {
 public:
  // GCC 12 takes scoped enumerators for shadowing declarations of the same
  // name (tn::Array); they cannot clash, so the warning is silenced here only.
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wshadow"
  enum class Kind : uint8_t { Null, Bool, Int, UInt, Double, String, Data, Date, UUID, Array, Dictionary };
#pragma GCC diagnostic pop

  Value() = default;
  Value(std::nullptr_t) {}  // NOLINT: null
  Value(bool b) : v_(b) {}  // NOLINT
  template <std::signed_integral T>
    requires(!std::same_as<T, char>)
  Value(T i) : v_(static_cast<int64_t>(i)) {}  // NOLINT
  template <std::unsigned_integral T>
    requires(!std::same_as<T, bool> && !std::same_as<T, char>)
  Value(T u) : v_(static_cast<uint64_t>(u)) {}  // NOLINT
  Value(double d) : v_(d) {}                     // NOLINT
  Value(const char* s) : Value(std::string(s)) {}  // NOLINT
  Value(std::string_view s) : Value(std::string(s)) {}  // NOLINT
  Value(std::string s);                          // NOLINT
  Value(Bytes data);                             // NOLINT
  Value(tn::Date d) : v_(d) {}                   // NOLINT
  Value(tn::UUID u) : v_(u) {}                   // NOLINT
  Value(tn::Array a);                            // NOLINT
  Value(tn::Dictionary d);                       // NOLINT

  Kind kind() const { return static_cast<Kind>(v_.index()); }
  bool isNull() const { return kind() == Kind::Null; }
  bool isNumber() const;  // bool, either integer, or double
  bool isString() const { return kind() == Kind::String; }
  bool isArray() const { return kind() == Kind::Array; }
  bool isDictionary() const { return kind() == Kind::Dictionary; }

  // Typed reads. Each answers none (nullptr or nullopt) when the value is of
  // another kind; only the integer reads convert, and only losslessly.
  std::optional<bool> boolean() const;     // Bool
  std::optional<int64_t> int64() const;    // Int, or UInt <= INT64_MAX
  std::optional<uint64_t> uint64() const;  // UInt, or Int >= 0
  std::optional<double> real() const;      // Double
  std::optional<double> numberAsDouble() const;  // any number kind
  const std::string* string() const;
  const Bytes* data() const;
  std::optional<tn::Date> date() const;
  std::optional<tn::UUID> uuid() const;
  const tn::Array* array() const;
  const tn::Dictionary* dictionary() const;

  // The value under key when this is a dictionary holding it, else null.
  const Value& operator[](std::string_view key) const;

  // Copy-on-write access to a container payload; nullptr when the value is
  // of another kind.
  tn::Array* editArray();
  tn::Dictionary* editDictionary();

  // Same kinds and contents all the way down (NaN equals NaN; dictionaries
  // in any order).
  static bool identical(const Value& a, const Value& b);

  // One-line text for logs and trace probes, e.g.
  // {request: "match", version: 3, uuids: [E621E1F8-...]}.
  std::string description() const;

  friend bool operator==(const Value& a, const Value& b);

  static const Value& null();
  static std::string_view kindName(Kind kind);

 private:
  using Storage = std::variant<std::monostate, bool, int64_t, uint64_t, double,
                               std::shared_ptr<const std::string>, std::shared_ptr<const Bytes>,
                               tn::Date, tn::UUID, std::shared_ptr<const tn::Array>,
                               std::shared_ptr<const tn::Dictionary>>;
  Storage v_;
};

// A dictionary with string keys that keeps insertion order. Lookups compare
// keys byte for byte; larger dictionaries keep a hash index so a lookup stays
// O(1) for the 10,000-entry documents the stores hold.
class Dictionary {
 public:
  using Entry = std::pair<std::string, Value>;
  using const_iterator = std::vector<Entry>::const_iterator;

  Dictionary() = default;
  Dictionary(std::initializer_list<Entry> entries);

  size_t size() const { return entries_.size(); }
  bool empty() const { return entries_.empty(); }
  const_iterator begin() const { return entries_.begin(); }
  const_iterator end() const { return entries_.end(); }
  const std::vector<Entry>& entries() const { return entries_; }

  const Value* find(std::string_view key) const;
  bool contains(std::string_view key) const { return find(key) != nullptr; }
  // The value under key, or null.
  const Value& get(std::string_view key) const;

  // Replaces the value in place when the key exists, else appends.
  void set(std::string key, Value value);
  // Appends when the key is new; answers false and changes nothing otherwise.
  bool insertNew(std::string key, Value value);
  // Answers whether the key was there.
  bool erase(std::string_view key);
  void reserve(size_t n) { entries_.reserve(n); }

  // Same key set with equal values, in any order.
  friend bool operator==(const Dictionary& a, const Dictionary& b);

 private:
  static constexpr size_t kLinearLimit = 12;
  static constexpr uint32_t kEmptySlot = UINT32_MAX;

  size_t slotFor(std::string_view key) const;  // probe start
  void rebuildIndex();
  void indexEntry(uint32_t position);

  std::vector<Entry> entries_;
  std::vector<uint32_t> index_;  // open addressing over entries_; empty when small
};

// The description, so that test failures and streams show the value.
std::ostream& operator<<(std::ostream& out, const Value& value);

}  // namespace tn

template <>
struct fmt::formatter<tn::Value> : fmt::formatter<std::string_view> {
  auto format(const tn::Value& v, fmt::format_context& ctx) const {
    return fmt::formatter<std::string_view>::format(v.description(), ctx);
  }
};
