// Encoding of tn::Value as CBOR (see Cbor.h for the mapping).
//
// Two passes: the first measures the encoding (and checks that every string
// is UTF-8), so the buffer grows once; the second writes through a raw
// cursor. Growing the vector item by item cost more than both passes.

#include <bit>
#include <cassert>
#include <cstring>

#include "platform/value/Cbor.h"
#include "platform/value/CborFormat.h"
#include "platform/value/Utf8.h"

namespace tn {
namespace {

using namespace cbor;

// Size of the shortest head that carries the argument.
size_t headSize(uint64_t argument) {
  if (argument < kOneByteArgument) return 1;
  if (argument <= 0xFF) return 2;
  if (argument <= 0xFFFF) return 3;
  if (argument <= 0xFFFFFFFF) return 5;
  return 9;
}

constexpr size_t kFloat64Size = 9;

// The first pass: the encoded size of a value, and whether all its text
// (strings and keys) is valid UTF-8.
class Measure {
 public:
  explicit Measure(CborDialect dialect) : dialect_(dialect) {}

  size_t size() const { return size_; }
  bool textIsValid() const { return textIsValid_; }

  void add(const Value& value) {
    switch (value.kind()) {
      case Value::Kind::Null:
      case Value::Kind::Bool: size_ += 1; break;
      case Value::Kind::Int: addSigned(*value.int64()); break;
      case Value::Kind::UInt: size_ += headSize(*value.uint64()); break;
      case Value::Kind::Double: size_ += kFloat64Size; break;
      case Value::Kind::String: addText(*value.string()); break;
      case Value::Kind::Data: size_ += headSize(value.data()->size()) + value.data()->size(); break;
      case Value::Kind::Date: size_ += headSize(kCborDateTag) + kFloat64Size; break;
      case Value::Kind::UUID: size_ += headSize(kCborUUIDTag) + headSize(kUUIDSize) + kUUIDSize; break;
      case Value::Kind::Array:
        size_ += headSize(value.array()->size());
        for (const Value& element : *value.array()) add(element);
        break;
      case Value::Kind::Dictionary:
        size_ += headSize(value.dictionary()->size());
        for (const auto& [key, element] : *value.dictionary()) {
          addText(key);
          add(element);
        }
        break;
    }
  }

 private:
  void addSigned(int64_t value) {
    if (value < 0) {
      size_ += headSize(static_cast<uint64_t>(-1 - value));
      return;
    }
    if (dialect_ == CborDialect::Typed) size_ += headSize(kCborTypedIntegerTag);
    size_ += headSize(static_cast<uint64_t>(value));
  }

  void addText(std::string_view text) {
    size_ += headSize(text.size()) + text.size();
    if (textIsValid_ && !isValidUtf8(text)) textIsValid_ = false;
  }

  const CborDialect dialect_;
  size_t size_ = 0;
  bool textIsValid_ = true;
};

// The second pass: writes a value whose size was measured into memory
// reserved for it.
class Writer {
 public:
  Writer(uint8_t* cursor, CborDialect dialect) : cursor_(cursor), dialect_(dialect) {}

  // Where the next byte would go.
  const uint8_t* cursor() const { return cursor_; }

  // The head of a map or array of `count` entries, whose entries follow.
  void writeContainerHead(Major major, uint64_t count) { writeHead(major, count); }

  void write(const Value& value) {
    switch (value.kind()) {
      case Value::Kind::Null: *cursor_++ = initialByte(kSimple, kNull); break;
      case Value::Kind::Bool: *cursor_++ = initialByte(kSimple, *value.boolean() ? kTrue : kFalse); break;
      case Value::Kind::Int: writeSigned(*value.int64()); break;
      case Value::Kind::UInt: writeHead(kUnsigned, *value.uint64()); break;
      case Value::Kind::Double: writeFloat64(*value.real()); break;
      case Value::Kind::String: writeString(kTextString, value.string()->data(), value.string()->size()); break;
      case Value::Kind::Data: writeString(kByteString, value.data()->data(), value.data()->size()); break;
      case Value::Kind::Date:
        writeHead(kTag, kCborDateTag);
        writeFloat64(value.date()->secondsSince1970);
        break;
      case Value::Kind::UUID:
        writeHead(kTag, kCborUUIDTag);
        writeString(kByteString, value.uuid()->bytes().data(), kUUIDSize);
        break;
      case Value::Kind::Array:
        writeHead(kArray, value.array()->size());
        for (const Value& element : *value.array()) write(element);
        break;
      case Value::Kind::Dictionary:
        writeHead(kMap, value.dictionary()->size());
        for (const auto& [key, element] : *value.dictionary()) {
          writeString(kTextString, key.data(), key.size());
          write(element);
        }
        break;
    }
  }

 private:
  void storeBigEndian(uint64_t value, size_t size) {
    for (size_t i = 0; i < size; ++i) cursor_[i] = static_cast<uint8_t>(value >> (8 * (size - 1 - i)));
    cursor_ += size;
  }

  // The shortest head for the argument, as the protocol requires of integers
  // and lengths alike.
  void writeHead(Major major, uint64_t argument) {
    switch (headSize(argument)) {
      case 1: *cursor_++ = initialByte(major, static_cast<uint8_t>(argument)); return;
      case 2: *cursor_++ = initialByte(major, kOneByteArgument); storeBigEndian(argument, 1); return;
      case 3: *cursor_++ = initialByte(major, kTwoByteArgument); storeBigEndian(argument, 2); return;
      case 5: *cursor_++ = initialByte(major, kFourByteArgument); storeBigEndian(argument, 4); return;
      default: *cursor_++ = initialByte(major, kEightByteArgument); storeBigEndian(argument, 8); return;
    }
  }

  void writeSigned(int64_t value) {
    if (value < 0) {
      // -1 - value cannot overflow for any negative int64.
      writeHead(kNegative, static_cast<uint64_t>(-1 - value));
      return;
    }
    if (dialect_ == CborDialect::Typed) writeHead(kTag, kCborTypedIntegerTag);
    writeHead(kUnsigned, static_cast<uint64_t>(value));
  }

  void writeFloat64(double d) {
    *cursor_++ = initialByte(kSimple, kFloat64);
    storeBigEndian(std::bit_cast<uint64_t>(d), 8);
  }

  void writeString(Major major, const void* bytes, size_t size) {
    writeHead(major, size);
    // memcpy from an empty string's possibly-null data is undefined.
    if (size != 0) std::memcpy(cursor_, bytes, size);
    cursor_ += size;
  }

  uint8_t* cursor_;
  const CborDialect dialect_;
};

// value with every string and key made valid UTF-8 (repairedUtf8). Keys
// that become equal that way would repeat in a map, so the first is kept.
Value withRepairedText(const Value& value) {
  if (const std::string* text = value.string()) return Value(repairedUtf8(*text));
  if (const Array* array = value.array()) {
    Array repaired;
    repaired.reserve(array->size());
    for (const Value& element : *array) repaired.push_back(withRepairedText(element));
    return Value(std::move(repaired));
  }
  if (const Dictionary* dictionary = value.dictionary()) {
    Dictionary repaired;
    repaired.reserve(dictionary->size());
    for (const auto& [key, element] : *dictionary) repaired.insertNew(repairedUtf8(key), withRepairedText(element));
    return Value(std::move(repaired));
  }
  return value;
}

}  // namespace

void appendCbor(Bytes& out, const Value& value, CborDialect dialect) {
  Measure measure(dialect);
  measure.add(value);
  if (!measure.textIsValid()) {
    appendCbor(out, withRepairedText(value), dialect);
    return;
  }
  const size_t start = out.size();
  out.resize(start + measure.size());
  Writer writer(out.data() + start, dialect);
  writer.write(value);
  assert(writer.cursor() == out.data() + out.size());
}

namespace {

void appendContainerHead(Bytes& out, Major major, uint64_t count) {
  const size_t start = out.size();
  out.resize(start + headSize(count));
  Writer(out.data() + start, CborDialect::Wire).writeContainerHead(major, count);
}

}  // namespace

void appendCborMapHead(Bytes& out, uint64_t count) { appendContainerHead(out, kMap, count); }

void appendCborArrayHead(Bytes& out, uint64_t count) { appendContainerHead(out, kArray, count); }

void appendCborEntry(Bytes& out, std::string_view key, const Value& value, CborDialect dialect) {
  appendCbor(out, Value(key), dialect);
  appendCbor(out, value, dialect);
}

Bytes encodeCbor(const Value& value, CborDialect dialect) {
  Bytes out;
  appendCbor(out, value, dialect);
  return out;
}

}  // namespace tn
