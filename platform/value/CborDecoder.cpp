// Strict decoding of CBOR into tn::Value (see Cbor.h for the rules).
//
// The decoder walks the input once and builds values as it goes. Inner
// functions answer false after recording the first error, rather than each
// returning a Result, so the common path moves no error objects around; the
// public entry points turn that into a Result.

#include <algorithm>
#include <bit>
#include <cmath>
#include <limits>
#include <optional>

#include "platform/value/Cbor.h"
#include "platform/value/CborFormat.h"
#include "platform/value/Utf8.h"

namespace tn {
namespace {

using namespace cbor;

// The initial byte of an item and its argument (a value, length, count, tag
// number or float bits), and where the item starts.
struct Head {
  size_t offset = 0;
  Major major = kUnsigned;
  uint8_t info = 0;
  uint64_t argument = 0;
};

// Containers never reserve more than this up front: a declared count is only
// a claim until the elements are there.
constexpr size_t kMaxReservation = 1024;

constexpr uint64_t kInt64Max = static_cast<uint64_t>(std::numeric_limits<int64_t>::max());

double halfToDouble(uint16_t half) {
  const bool negative = half >> 15;
  const int exponent = (half >> 10) & 0x1F;
  const uint64_t mantissa = half & 0x3FF;
  if (exponent == 0x1F) {
    // Infinity or NaN: keep the sign and the payload bits in place.
    const uint64_t bits = (uint64_t{negative} << 63) | 0x7FF0000000000000ULL | (mantissa << 42);
    return std::bit_cast<double>(bits);
  }
  const double magnitude = exponent == 0 ? std::ldexp(static_cast<double>(mantissa), -24)
                                         : std::ldexp(static_cast<double>(mantissa | 0x400), exponent - 25);
  return negative ? -magnitude : magnitude;
}

double singleToDouble(uint32_t single) {
  if (((single >> 23) & 0xFF) == 0xFF) {
    // Converting through float would quiet a signalling NaN; move the bits.
    const uint64_t bits = (uint64_t{single >> 31} << 63) | 0x7FF0000000000000ULL |
                          (uint64_t{single & 0x7FFFFF} << 29);
    return std::bit_cast<double>(bits);
  }
  return static_cast<double>(std::bit_cast<float>(single));
}

bool isFloatHead(const Head& head) {
  return head.major == kSimple && head.info >= kFloat16 && head.info <= kFloat64;
}

double floatOf(const Head& head) {
  switch (head.info) {
    case kFloat16: return halfToDouble(static_cast<uint16_t>(head.argument));
    case kFloat32: return singleToDouble(static_cast<uint32_t>(head.argument));
    default: return std::bit_cast<double>(head.argument);
  }
}

// "an array", "a text string": what an item is, for error messages.
std::string_view describeItem(const Head& head) {
  switch (head.major) {
    case kUnsigned: return "an unsigned integer";
    case kNegative: return "a negative integer";
    case kByteString: return "a byte string";
    case kTextString: return "a text string";
    case kArray: return "an array";
    case kMap: return "a map";
    case kTag: return "a tag";
    case kSimple: break;
  }
  if (head.info == kFalse || head.info == kTrue) return "a boolean";
  if (head.info == kNull) return "null";
  if (isFloatHead(head)) return "a floating-point number";
  return "a simple value";
}

std::string_view majorName(Major major) {
  switch (major) {
    case kByteString: return "byte string";
    case kTextString: return "text string";
    case kArray: return "array";
    case kMap: return "map";
    case kUnsigned: return "unsigned integer";
    case kNegative: return "negative integer";
    case kTag: return "tag";
    case kSimple: return "simple value";
  }
  return "item";
}

// A key as it may appear in an error message: quoted, control characters
// escaped, and long keys cut (on a character boundary) so that a hostile
// peer cannot flood the log.
std::string quotedForMessage(std::string_view text) {
  constexpr size_t kLimit = 64;
  bool cut = false;
  if (text.size() > kLimit) {
    size_t end = kLimit;
    while (end > 0 && (static_cast<uint8_t>(text[end]) & 0xC0) == 0x80) --end;
    text = text.substr(0, end);
    cut = true;
  }
  std::string out = "\"";
  for (char c : text) {
    const auto b = static_cast<uint8_t>(c);
    if (c == '"' || c == '\\') {
      out.push_back('\\');
      out.push_back(c);
    } else if (b < 0x20 || b == 0x7F) {
      out += fmt::format("\\x{:02x}", b);
    } else {
      out.push_back(c);
    }
  }
  out += cut ? "\"..." : "\"";
  return out;
}

std::string negativeIntegerText(uint64_t argument) {
  // The value is -1 - argument, which may be -2^64.
  if (argument == std::numeric_limits<uint64_t>::max()) return "-18446744073709551616";
  return fmt::format("-{}", argument + 1);
}

class Decoder {
 public:
  Decoder(std::span<const uint8_t> input, CborDialect dialect) : input_(input), dialect_(dialect) {}

  Result<Value> decodeWhole(bool requireMap) {
    Head head;
    Value value;
    if (!readHead(head)) return takeError();
    if (requireMap && head.major != kMap)
      return failure(head.offset, CborErrorCode::NotAMap,
                     fmt::format("message body must be a map, found {}", describeItem(head)));
    if (!decodeFromHead(head, 0, value)) return takeError();
    if (pos_ != input_.size()) {
      const size_t extra = input_.size() - pos_;
      return failure(pos_, CborErrorCode::TrailingBytes,
                     fmt::format("{} trailing byte{} after the item", extra, extra == 1 ? "" : "s"));
    }
    return value;
  }

 private:
  size_t remaining() const { return input_.size() - pos_; }

  // Records the first error; answers false so callers can `return fail(...)`.
  bool fail(size_t offset, CborErrorCode code, std::string_view what) {
    error_ = failure(offset, code, what);
    return false;
  }

  static Error failure(size_t offset, CborErrorCode code, std::string_view what) {
    return Error(std::string(kCborErrorDomain), static_cast<int64_t>(code),
                 fmt::format("CBOR error at byte {}: {}", offset, what));
  }

  Error takeError() { return std::move(*error_); }

  uint64_t loadBigEndian(size_t size) {
    uint64_t value = 0;
    for (size_t i = 0; i < size; ++i) value = value << 8 | input_[pos_ + i];
    pos_ += size;
    return value;
  }

  bool readHead(Head& head) {
    head.offset = pos_;
    if (pos_ >= input_.size()) return fail(pos_, CborErrorCode::Truncated, "unexpected end of input");
    const uint8_t initial = input_[pos_++];
    head.major = static_cast<Major>(initial >> 5);
    head.info = initial & 0x1F;
    if (head.info < kOneByteArgument) {
      head.argument = head.info;
      return true;
    }
    if (head.info <= kEightByteArgument) {
      const size_t size = size_t{1} << (head.info - kOneByteArgument);
      if (remaining() < size)
        return fail(head.offset, CborErrorCode::Truncated, "unexpected end of input in the head of an item");
      head.argument = loadBigEndian(size);
      return true;
    }
    if (head.info < kIndefinite)
      return fail(head.offset, CborErrorCode::Malformed,
                  fmt::format("reserved additional information {}", head.info));
    return failIndefinite(head);
  }

  bool failIndefinite(const Head& head) {
    switch (head.major) {
      case kByteString:
      case kTextString:
      case kArray:
      case kMap:
        return fail(head.offset, CborErrorCode::IndefiniteLength,
                    fmt::format("indefinite-length {} not accepted", majorName(head.major)));
      case kSimple:
        return fail(head.offset, CborErrorCode::IndefiniteLength,
                    "break code outside an indefinite-length item");
      default:
        return fail(head.offset, CborErrorCode::Malformed,
                    fmt::format("additional information 31 is not valid for major type {} ({})",
                                static_cast<int>(head.major), majorName(head.major)));
    }
  }

  bool decodeItem(int depth, Value& out) {
    Head head;
    return readHead(head) && decodeFromHead(head, depth, out);
  }

  // depth: how many arrays and maps enclose the item.
  bool decodeFromHead(const Head& head, int depth, Value& out) {
    switch (head.major) {
      case kUnsigned: out = Value(head.argument); return true;
      case kNegative: {
        int64_t n;
        if (!negativeValue(head, n)) return false;
        out = Value(n);
        return true;
      }
      case kByteString: return decodeByteString(head, out);
      case kTextString: {
        std::string text;
        if (!readText(head, text)) return false;
        out = Value(std::move(text));
        return true;
      }
      case kArray: return decodeArray(head, depth + 1, out);
      case kMap: return decodeMap(head, depth + 1, out);
      case kTag: return decodeTag(head, out);
      case kSimple: return decodeSimple(head, out);
    }
    return false;
  }

  bool negativeValue(const Head& head, int64_t& out) {
    if (head.argument > kInt64Max)
      return fail(head.offset, CborErrorCode::IntegerOutOfRange,
                  fmt::format("negative integer {} is below the 64-bit signed range",
                              negativeIntegerText(head.argument)));
    out = -1 - static_cast<int64_t>(head.argument);
    return true;
  }

  // A string's length is checked against the input before anything is
  // allocated for it.
  bool checkLength(const Head& head) {
    if (head.argument <= remaining()) return true;
    return fail(head.offset, CborErrorCode::Truncated,
                fmt::format("{} of {} bytes exceeds the {} bytes remaining", majorName(head.major),
                            head.argument, remaining()));
  }

  bool decodeByteString(const Head& head, Value& out) {
    if (!checkLength(head)) return false;
    const auto* begin = input_.data() + pos_;
    out = Value(Bytes(begin, begin + head.argument));
    pos_ += head.argument;
    return true;
  }

  bool readText(const Head& head, std::string& out, std::string_view what = "text string") {
    if (!checkLength(head)) return false;
    const std::string_view text(reinterpret_cast<const char*>(input_.data() + pos_), head.argument);
    const size_t bad = firstInvalidUtf8(text);
    if (bad != text.size())
      return fail(pos_ + bad, CborErrorCode::InvalidUTF8, fmt::format("{} is not valid UTF-8", what));
    out.assign(text);
    pos_ += head.argument;
    return true;
  }

  bool checkDepth(const Head& head, int depth) {
    if (depth <= kMaxCborDepth) return true;
    return fail(head.offset, CborErrorCode::TooDeep, fmt::format("nesting deeper than {} levels", kMaxCborDepth));
  }

  // Each element takes at least one byte (a map entry two), so a count the
  // remaining input cannot hold is refused before anything is reserved.
  bool checkCount(const Head& head, size_t bytesPerElement) {
    if (head.argument <= remaining() / bytesPerElement) return true;
    return fail(head.offset, CborErrorCode::Truncated,
                fmt::format("{} of {} {} exceeds the {} bytes remaining", majorName(head.major),
                            head.argument, head.major == kMap ? "entries" : "items", remaining()));
  }

  bool decodeArray(const Head& head, int depth, Value& out) {
    if (!checkDepth(head, depth) || !checkCount(head, 1)) return false;
    Array array;
    array.reserve(std::min<uint64_t>(head.argument, kMaxReservation));
    for (uint64_t i = 0; i < head.argument; ++i) {
      Value element;
      if (!decodeItem(depth, element)) return false;
      array.push_back(std::move(element));
    }
    out = Value(std::move(array));
    return true;
  }

  bool decodeMap(const Head& head, int depth, Value& out) {
    if (!checkDepth(head, depth) || !checkCount(head, 2)) return false;
    Dictionary dictionary;
    dictionary.reserve(std::min<uint64_t>(head.argument, kMaxReservation));
    for (uint64_t i = 0; i < head.argument; ++i) {
      Head keyHead;
      std::string key;
      Value value;
      if (!readHead(keyHead) || !readKey(keyHead, key)) return false;
      // The key as it stands in the input, for the message should it turn
      // out to be a duplicate; the string itself moves into the dictionary.
      const std::string_view keyInInput(reinterpret_cast<const char*>(input_.data() + pos_ - key.size()),
                                        key.size());
      if (!decodeItem(depth, value)) return false;
      if (!dictionary.insertNew(std::move(key), std::move(value)))
        return fail(keyHead.offset, CborErrorCode::DuplicateMapKey,
                    fmt::format("duplicate map key {}", quotedForMessage(keyInInput)));
    }
    out = Value(std::move(dictionary));
    return true;
  }

  bool readKey(const Head& head, std::string& key) {
    if (head.major != kTextString)
      return fail(head.offset, CborErrorCode::InvalidMapKey,
                  fmt::format("map key must be a text string, found {}", describeItem(head)));
    return readText(head, key, "map key");
  }

  // The accepted tags enclose scalars only, so the enclosed item is read
  // here without recursion and tags add no depth.
  bool decodeTag(const Head& tag, Value& out) {
    Head content;
    if (tag.argument == kCborDateTag) return readHead(content) && decodeDate(content, out);
    if (tag.argument == kCborUUIDTag) return readHead(content) && decodeUUID(content, out);
    if (tag.argument == kCborTypedIntegerTag && dialect_ == CborDialect::Typed)
      return readHead(content) && decodeTypedInteger(content, out);
    return fail(tag.offset, CborErrorCode::UnknownTag, fmt::format("unknown tag {}", tag.argument));
  }

  bool decodeDate(const Head& content, Value& out) {
    double seconds;
    if (content.major == kUnsigned) {
      seconds = static_cast<double>(content.argument);
    } else if (content.major == kNegative) {
      int64_t n;
      if (!negativeValue(content, n)) return false;
      seconds = static_cast<double>(n);
    } else if (isFloatHead(content)) {
      seconds = floatOf(content);
    } else {
      return fail(content.offset, CborErrorCode::InvalidTagContent,
                  fmt::format("tag 1 (date) must enclose a number, found {}", describeItem(content)));
    }
    out = Value(Date{seconds});
    return true;
  }

  bool decodeUUID(const Head& content, Value& out) {
    if (content.major != kByteString)
      return fail(content.offset, CborErrorCode::InvalidTagContent,
                  fmt::format("tag 37 (UUID) must enclose a 16-byte byte string, found {}",
                              describeItem(content)));
    if (!checkLength(content)) return false;
    if (content.argument != kUUIDSize)
      return fail(content.offset, CborErrorCode::InvalidTagContent,
                  fmt::format("tag 37 (UUID) must enclose a 16-byte byte string, found {} bytes",
                              content.argument));
    UUID::Bytes bytes;
    std::copy_n(input_.data() + pos_, kUUIDSize, bytes.begin());
    pos_ += kUUIDSize;
    out = Value(UUID(bytes));
    return true;
  }

  bool decodeTypedInteger(const Head& content, Value& out) {
    if (content.major != kUnsigned || content.argument > kInt64Max)
      return fail(content.offset, CborErrorCode::InvalidTagContent,
                  fmt::format("tag {} (signed integer) must enclose an unsigned integer up to {}",
                              kCborTypedIntegerTag, kInt64Max));
    out = Value(static_cast<int64_t>(content.argument));
    return true;
  }

  bool decodeSimple(const Head& head, Value& out) {
    switch (head.info) {
      case kFalse: out = Value(false); return true;
      case kTrue: out = Value(true); return true;
      case kNull: out = Value(); return true;
      case kFloat16:
      case kFloat32:
      case kFloat64: out = Value(floatOf(head)); return true;
      case kUndefined:
        return fail(head.offset, CborErrorCode::UnsupportedSimpleValue, "unsupported simple value 23 (undefined)");
      default:
        return fail(head.offset, CborErrorCode::UnsupportedSimpleValue,
                    fmt::format("unsupported simple value {}", head.argument));
    }
  }

  const std::span<const uint8_t> input_;
  const CborDialect dialect_;
  size_t pos_ = 0;
  std::optional<Error> error_;
};

}  // namespace

bool isCborError(const Error& error, CborErrorCode code) {
  return error.domain() == kCborErrorDomain && error.code() == static_cast<int64_t>(code);
}

Result<Value> decodeCbor(std::span<const uint8_t> bytes, CborDialect dialect) {
  return Decoder(bytes, dialect).decodeWhole(false);
}

Result<Value> decodeMessageBody(std::span<const uint8_t> bytes) {
  return Decoder(bytes, CborDialect::Wire).decodeWhole(true);
}

}  // namespace tn
