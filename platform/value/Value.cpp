#include "platform/value/Value.h"

#include <cmath>
#include <functional>
#include <limits>

namespace tn {
namespace {

__extension__ typedef __int128 Int128;  // exact comparison of int64 with uint64

bool isIntegerKind(Value::Kind k) {
  return k == Value::Kind::Bool || k == Value::Kind::Int || k == Value::Kind::UInt;
}

Int128 integerOf(const Value& v) {
  switch (v.kind()) {
    case Value::Kind::Bool: return *v.boolean() ? 1 : 0;
    case Value::Kind::Int: return *v.int64();
    default: return static_cast<Int128>(*v.uint64());
  }
}

bool doubleEqualsInteger(double d, Int128 i) {
  // 2^64 is the first double above every uint64; below -2^63 no int64 fits.
  if (!std::isfinite(d) || d != std::floor(d) || d >= 18446744073709551616.0 ||
      d < -9223372036854775808.0)
    return false;
  return static_cast<Int128>(d) == i;
}

bool doublesEqual(double a, double b) { return a == b || (std::isnan(a) && std::isnan(b)); }

// identical() also tells -0.0 from 0.0: an encoding that loses the sign lost something.
bool doublesIdentical(double a, double b) {
  return doublesEqual(a, b) && std::signbit(a) == std::signbit(b);
}

bool numbersEqual(const Value& a, const Value& b) {
  const bool ai = isIntegerKind(a.kind()), bi = isIntegerKind(b.kind());
  if (ai && bi) return integerOf(a) == integerOf(b);
  if (!ai && !bi) return doublesEqual(*a.real(), *b.real());
  return ai ? doubleEqualsInteger(*b.real(), integerOf(a)) : doubleEqualsInteger(*a.real(), integerOf(b));
}

template <typename Equal>
bool arraysEqual(const Array& a, const Array& b, Equal eq) {
  if (a.size() != b.size()) return false;
  for (size_t i = 0; i < a.size(); ++i)
    if (!eq(a[i], b[i])) return false;
  return true;
}

template <typename Equal>
bool dictionariesEqual(const Dictionary& a, const Dictionary& b, Equal eq) {
  if (a.size() != b.size()) return false;
  for (const auto& [key, value] : a) {
    const Value* other = b.find(key);
    if (!other || !eq(value, *other)) return false;
  }
  return true;
}

// Same-kind comparison of non-number payloads (shared by both equalities).
template <typename Equal>
bool samePayload(const Value& a, const Value& b, Equal eq) {
  switch (a.kind()) {
    case Value::Kind::Null: return true;
    case Value::Kind::String: return *a.string() == *b.string();
    case Value::Kind::Data: return *a.data() == *b.data();
    case Value::Kind::Date: return *a.date() == *b.date();
    case Value::Kind::UUID: return *a.uuid() == *b.uuid();
    case Value::Kind::Array: return arraysEqual(*a.array(), *b.array(), eq);
    case Value::Kind::Dictionary: return dictionariesEqual(*a.dictionary(), *b.dictionary(), eq);
    default: return false;
  }
}

void appendQuoted(std::string& out, std::string_view s) {
  out.push_back('"');
  for (char c : s) {
    switch (c) {
      case '"': out += "\\\""; break;
      case '\\': out += "\\\\"; break;
      case '\n': out += "\\n"; break;
      case '\t': out += "\\t"; break;
      case '\r': out += "\\r"; break;
      default:
        if (static_cast<unsigned char>(c) < 0x20)
          out += fmt::format("\\u{:04x}", static_cast<unsigned>(c));
        else
          out.push_back(c);
    }
  }
  out.push_back('"');
}

bool isBareKey(std::string_view key) {
  if (key.empty()) return false;
  for (char c : key)
    if (!(std::isalnum(static_cast<unsigned char>(c)) || c == '_' || c == '.' || c == '-')) return false;
  return true;
}

void describe(const Value& v, std::string& out) {
  switch (v.kind()) {
    case Value::Kind::Null: out += "null"; break;
    case Value::Kind::Bool: out += *v.boolean() ? "true" : "false"; break;
    case Value::Kind::Int: out += fmt::format("{}", *v.int64()); break;
    case Value::Kind::UInt: out += fmt::format("{}", *v.uint64()); break;
    case Value::Kind::Double: out += fmt::format("{}", *v.real()); break;
    case Value::Kind::String: appendQuoted(out, *v.string()); break;
    case Value::Kind::Data: {
      const Bytes& d = *v.data();
      out += fmt::format("<{} bytes", d.size());
      if (!d.empty()) out += ": ";
      for (size_t i = 0; i < d.size() && i < 16; ++i) out += fmt::format("{:02x}", d[i]);
      if (d.size() > 16) out += "...";
      out += ">";
      break;
    }
    case Value::Kind::Date: {
      const Date d = *v.date();
      out += hasISO8601Form(d) ? formatISO8601(d) : fmt::format("date({})", d.secondsSince1970);
      break;
    }
    case Value::Kind::UUID: out += v.uuid()->string(); break;
    case Value::Kind::Array: {
      out.push_back('[');
      bool first = true;
      for (const Value& e : *v.array()) {
        if (!first) out += ", ";
        first = false;
        describe(e, out);
      }
      out.push_back(']');
      break;
    }
    case Value::Kind::Dictionary: {
      out.push_back('{');
      bool first = true;
      for (const auto& [key, value] : *v.dictionary()) {
        if (!first) out += ", ";
        first = false;
        if (isBareKey(key)) out += key; else appendQuoted(out, key);
        out += ": ";
        describe(value, out);
      }
      out.push_back('}');
      break;
    }
  }
}

}  // namespace

Value::Value(std::string s) : v_(std::make_shared<const std::string>(std::move(s))) {}
Value::Value(Bytes data) : v_(std::make_shared<const Bytes>(std::move(data))) {}
Value::Value(tn::Array a) : v_(std::make_shared<const tn::Array>(std::move(a))) {}
Value::Value(tn::Dictionary d) : v_(std::make_shared<const tn::Dictionary>(std::move(d))) {}

bool Value::isNumber() const {
  const Kind k = kind();
  return k == Kind::Bool || k == Kind::Int || k == Kind::UInt || k == Kind::Double;
}

std::optional<bool> Value::boolean() const {
  if (auto* b = std::get_if<bool>(&v_)) return *b;
  return std::nullopt;
}

std::optional<int64_t> Value::int64() const {
  if (auto* i = std::get_if<int64_t>(&v_)) return *i;
  if (auto* u = std::get_if<uint64_t>(&v_); u && *u <= uint64_t(std::numeric_limits<int64_t>::max()))
    return static_cast<int64_t>(*u);
  return std::nullopt;
}

std::optional<uint64_t> Value::uint64() const {
  if (auto* u = std::get_if<uint64_t>(&v_)) return *u;
  if (auto* i = std::get_if<int64_t>(&v_); i && *i >= 0) return static_cast<uint64_t>(*i);
  return std::nullopt;
}

std::optional<double> Value::real() const {
  if (auto* d = std::get_if<double>(&v_)) return *d;
  return std::nullopt;
}

std::optional<double> Value::numberAsDouble() const {
  switch (kind()) {
    case Kind::Bool: return *boolean() ? 1.0 : 0.0;
    case Kind::Int: return static_cast<double>(std::get<int64_t>(v_));
    case Kind::UInt: return static_cast<double>(std::get<uint64_t>(v_));
    case Kind::Double: return std::get<double>(v_);
    default: return std::nullopt;
  }
}

const std::string* Value::string() const {
  auto* p = std::get_if<std::shared_ptr<const std::string>>(&v_);
  return p ? p->get() : nullptr;
}

const Bytes* Value::data() const {
  auto* p = std::get_if<std::shared_ptr<const Bytes>>(&v_);
  return p ? p->get() : nullptr;
}

std::optional<tn::Date> Value::date() const {
  if (auto* d = std::get_if<tn::Date>(&v_)) return *d;
  return std::nullopt;
}

std::optional<tn::UUID> Value::uuid() const {
  if (auto* u = std::get_if<tn::UUID>(&v_)) return *u;
  return std::nullopt;
}

const tn::Array* Value::array() const {
  auto* p = std::get_if<std::shared_ptr<const tn::Array>>(&v_);
  return p ? p->get() : nullptr;
}

const tn::Dictionary* Value::dictionary() const {
  auto* p = std::get_if<std::shared_ptr<const tn::Dictionary>>(&v_);
  return p ? p->get() : nullptr;
}

const Value& Value::operator[](std::string_view key) const {
  const tn::Dictionary* d = dictionary();
  return d ? d->get(key) : null();
}

tn::Array* Value::editArray() {
  auto* p = std::get_if<std::shared_ptr<const tn::Array>>(&v_);
  if (!p) return nullptr;
  if (p->use_count() != 1) *p = std::make_shared<const tn::Array>(**p);
  // The payload is owned by this value alone now, so writing it is safe.
  return const_cast<tn::Array*>(p->get());
}

tn::Dictionary* Value::editDictionary() {
  auto* p = std::get_if<std::shared_ptr<const tn::Dictionary>>(&v_);
  if (!p) return nullptr;
  if (p->use_count() != 1) *p = std::make_shared<const tn::Dictionary>(**p);
  return const_cast<tn::Dictionary*>(p->get());
}

bool Value::identical(const Value& a, const Value& b) {
  if (a.kind() != b.kind()) return false;
  switch (a.kind()) {
    case Kind::Bool: return *a.boolean() == *b.boolean();
    case Kind::Int: return std::get<int64_t>(a.v_) == std::get<int64_t>(b.v_);
    case Kind::UInt: return std::get<uint64_t>(a.v_) == std::get<uint64_t>(b.v_);
    case Kind::Double: return doublesIdentical(*a.real(), *b.real());
    default: return samePayload(a, b, &Value::identical);
  }
}

bool operator==(const Value& a, const Value& b) {
  if (a.isNumber() && b.isNumber()) return numbersEqual(a, b);
  if (a.kind() != b.kind()) return false;
  return samePayload(a, b, [](const Value& x, const Value& y) { return x == y; });
}

std::string Value::description() const {
  std::string out;
  describe(*this, out);
  return out;
}

std::ostream& operator<<(std::ostream& out, const Value& value) { return out << value.description(); }

const Value& Value::null() {
  static const Value kNull;
  return kNull;
}

std::string_view Value::kindName(Kind kind) {
  switch (kind) {
    case Kind::Null: return "null";
    case Kind::Bool: return "bool";
    case Kind::Int: return "int";
    case Kind::UInt: return "uint";
    case Kind::Double: return "real";
    case Kind::String: return "string";
    case Kind::Data: return "data";
    case Kind::Date: return "date";
    case Kind::UUID: return "uuid";
    case Kind::Array: return "array";
    case Kind::Dictionary: return "dictionary";
  }
  return "?";
}

// ---- Dictionary ----

Dictionary::Dictionary(std::initializer_list<Entry> entries) {
  entries_.reserve(entries.size());
  for (const Entry& e : entries) set(e.first, e.second);
}

size_t Dictionary::slotFor(std::string_view key) const {
  return std::hash<std::string_view>{}(key) & (index_.size() - 1);
}

const Value* Dictionary::find(std::string_view key) const {
  if (index_.empty()) {
    for (const Entry& e : entries_)
      if (e.first == key) return &e.second;
    return nullptr;
  }
  for (size_t slot = slotFor(key);; slot = (slot + 1) & (index_.size() - 1)) {
    const uint32_t position = index_[slot];
    if (position == kEmptySlot) return nullptr;
    if (entries_[position].first == key) return &entries_[position].second;
  }
}

const Value& Dictionary::get(std::string_view key) const {
  const Value* v = find(key);
  return v ? *v : Value::null();
}

void Dictionary::indexEntry(uint32_t position) {
  size_t slot = slotFor(entries_[position].first);
  while (index_[slot] != kEmptySlot) slot = (slot + 1) & (index_.size() - 1);
  index_[slot] = position;
}

void Dictionary::rebuildIndex() {
  index_.clear();
  if (entries_.size() <= kLinearLimit) return;
  size_t capacity = 32;
  while (capacity < entries_.size() * 2) capacity *= 2;
  index_.assign(capacity, kEmptySlot);
  for (uint32_t i = 0; i < entries_.size(); ++i) indexEntry(i);
}

bool Dictionary::insertNew(std::string key, Value value) {
  if (find(key)) return false;
  entries_.emplace_back(std::move(key), std::move(value));
  // Keep the table at most half full; grow by rebuilding.
  if (entries_.size() > kLinearLimit && entries_.size() * 2 > index_.size())
    rebuildIndex();
  else if (!index_.empty())
    indexEntry(static_cast<uint32_t>(entries_.size() - 1));
  return true;
}

void Dictionary::set(std::string key, Value value) {
  // find() yields a pointer into entries_, which this object owns.
  if (const Value* existing = find(key)) {
    *const_cast<Value*>(existing) = std::move(value);
    return;
  }
  insertNew(std::move(key), std::move(value));
}

bool Dictionary::erase(std::string_view key) {
  for (auto it = entries_.begin(); it != entries_.end(); ++it) {
    if (it->first == key) {
      entries_.erase(it);
      rebuildIndex();
      return true;
    }
  }
  return false;
}

bool operator==(const Dictionary& a, const Dictionary& b) {
  return dictionariesEqual(a, b, [](const Value& x, const Value& y) { return x == y; });
}

}  // namespace tn
