// The JSON reader: nlohmann's parser in SAX mode building tn::Value
// directly. The parser is not recursive; this builder caps the nesting and
// refuses duplicate keys, and a position-tracking input iterator lets both
// errors name the line they happened on.
//
// Numbers: an integer literal (no fraction, no exponent) becomes an Int when
// it fits in int64, else a UInt when it fits in uint64, else a double; any
// literal with a fraction or exponent becomes a double; a literal too large
// for a double is an error.

#include <exception>
#include <iterator>
#include <limits>
#include <optional>
#include <vector>

#include <fmt/format.h>
#include <nlohmann/json.hpp>

#include "platform/value/DocumentReaders.h"
#include "platform/value/DocumentUtf8.h"

namespace tn::document {
namespace {

using Json = nlohmann::json;

// A plain input iterator over the bytes that records how far the parser has
// read, so that a SAX callback can tell where in the input it is.
class TrackingIterator {
 public:
  using iterator_category = std::input_iterator_tag;
  using value_type = char;
  using difference_type = std::ptrdiff_t;
  using pointer = const char*;
  using reference = const char&;

  TrackingIterator(const char* position, const char** furthest) : position_(position), furthest_(furthest) {}

  reference operator*() const { return *position_; }
  TrackingIterator& operator++() {
    *furthest_ = ++position_;
    return *this;
  }
  TrackingIterator operator++(int) {
    TrackingIterator before = *this;
    ++*this;
    return before;
  }
  friend bool operator==(const TrackingIterator& a, const TrackingIterator& b) { return a.position_ == b.position_; }

 private:
  const char* position_;
  const char** furthest_;
};

// nlohmann's messages, without its exception prefix and its own position
// ("[json.exception.parse_error.101] parse error at line 6, column 3: "),
// cut short when they quote a long token.
std::string reasonFromParserMessage(std::string_view message) {
  if (message.starts_with("[json.exception.")) {
    if (const size_t end = message.find("] "); end != std::string_view::npos) message.remove_prefix(end + 2);
  }
  if (message.starts_with("parse error")) {
    if (const size_t colon = message.find(": "); colon != std::string_view::npos) message.remove_prefix(colon + 2);
  }
  constexpr size_t kLongest = 200;
  if (message.size() <= kLongest) return std::string(message);
  size_t cut = kLongest;
  while (cut > 0 && (static_cast<unsigned char>(message[cut]) & 0xC0) == 0x80) --cut;
  return std::string(message.substr(0, cut)) + "...";
}

class ValueBuilder : public nlohmann::json_sax<Json> {
 public:
  ValueBuilder(const DocumentInput& input, const char* const* furthest) : input_(input), furthest_(furthest) {}

  bool null() override { return add(Value()); }
  bool boolean(bool b) override { return add(Value(b)); }
  bool number_integer(number_integer_t i) override { return add(Value(static_cast<int64_t>(i))); }
  bool number_unsigned(number_unsigned_t u) override {
    if (u <= static_cast<uint64_t>(std::numeric_limits<int64_t>::max())) return add(Value(static_cast<int64_t>(u)));
    return add(Value(static_cast<uint64_t>(u)));
  }
  bool number_float(number_float_t d, const string_t& /*literal*/) override { return add(Value(d)); }
  bool string(string_t& s) override { return add(Value(std::move(s))); }
  bool binary(binary_t& /*bytes*/) override { return fail(DocumentErrorCode::Malformed, "binary values are not JSON"); }

  bool start_object(std::size_t /*elements*/) override { return open(true); }
  bool start_array(std::size_t /*elements*/) override { return open(false); }

  bool key(string_t& key) override {
    Frame& frame = stack_.back();
    if (frame.object.find(key)) return fail(DocumentErrorCode::Invalid, fmt::format("duplicate key {}", quotedForMessage(key)));
    frame.key = std::move(key);
    return true;
  }

  bool end_object() override { return close(); }
  bool end_array() override { return close(); }

  bool parse_error(std::size_t position, const std::string& /*token*/, const nlohmann::detail::exception& e) override {
    // position counts the characters read; the last one read is at fault.
    error_ = input_.errorAt(position > 0 ? position - 1 : 0, DocumentErrorCode::Malformed,
                            reasonFromParserMessage(e.what()));
    return false;
  }

  std::optional<Value>& root() { return root_; }
  const std::optional<Error>& error() const { return error_; }

 private:
  // A container being read.
  struct Frame {
    bool isObject;
    Array array;
    Dictionary object;
    std::string key;  // of the member being read
  };

  // The offset of the last byte the parser has read.
  size_t lastReadOffset() const {
    const size_t read = static_cast<size_t>(*furthest_ - input_.bytes().data());
    return read > 0 ? read - 1 : 0;
  }

  bool fail(DocumentErrorCode code, std::string_view reason) {
    error_ = input_.errorAt(lastReadOffset(), code, reason);
    return false;
  }

  bool open(bool isObject) {
    if (stack_.size() >= static_cast<size_t>(kMaxDocumentDepth))
      return fail(DocumentErrorCode::TooDeep, fmt::format("containers nested deeper than {}", kMaxDocumentDepth));
    stack_.push_back(Frame{isObject, {}, {}, {}});
    return true;
  }

  bool close() {
    Frame frame = std::move(stack_.back());
    stack_.pop_back();
    return frame.isObject ? add(Value(std::move(frame.object))) : add(Value(std::move(frame.array)));
  }

  bool add(Value v) {
    if (stack_.empty()) {
      root_ = std::move(v);
    } else if (Frame& frame = stack_.back(); frame.isObject) {
      // key() has refused a duplicate already.
      frame.object.insertNew(std::move(frame.key), std::move(v));
    } else {
      frame.array.push_back(std::move(v));
    }
    return true;
  }

  const DocumentInput& input_;
  const char* const* furthest_;
  std::vector<Frame> stack_;
  std::optional<Value> root_;
  std::optional<Error> error_;
};

}  // namespace

Result<Value> readJsonDocument(const DocumentInput& input) {
  const std::string_view bytes = input.bytes();
  // The parser checks UTF-8 inside strings only, and without a position.
  if (const size_t bad = firstInvalidUtf8(bytes); bad < bytes.size())
    return input.errorAt(bad, DocumentErrorCode::Malformed, "invalid UTF-8");
  const char* furthest = bytes.data();
  ValueBuilder builder(input, &furthest);
  try {
    const bool parsed = Json::sax_parse(TrackingIterator(bytes.data(), &furthest),
                                        TrackingIterator(bytes.data() + bytes.size(), &furthest), &builder);
    if (!parsed || !builder.root()) {
      if (builder.error()) return *builder.error();
      return input.errorAt(bytes.size(), DocumentErrorCode::Malformed, "no value");
    }
  } catch (const std::exception& e) {
    return input.errorAt(bytes.size(), DocumentErrorCode::Malformed, fmt::format("cannot read: {}", e.what()));
  }
  return std::move(*builder.root());
}

}  // namespace tn::document
