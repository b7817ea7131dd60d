// The JSON writer, for people and tools that want JSON (tnctl document
// --to json). JSON holds less than a tn::Value; Document.h lists what is
// mapped and what is refused, and docs/documents.md explains why.

#include <charconv>
#include <cmath>
#include <iterator>
#include <optional>

#include <fmt/format.h>

#include "platform/value/Base64.h"
#include "platform/value/Document.h"
#include "platform/value/DocumentUtf8.h"
#include "platform/value/ValuePath.h"

namespace tn {
namespace {

using document::ValuePath;

void appendQuotedUtf8(std::string& out, std::string_view text) {
  out.push_back('"');
  for (char c : text) {
    switch (c) {
      case '"': out += "\\\""; break;
      case '\\': out += "\\\\"; break;
      case '\n': out += "\\n"; break;
      case '\r': out += "\\r"; break;
      case '\t': out += "\\t"; break;
      case '\b': out += "\\b"; break;
      case '\f': out += "\\f"; break;
      default:
        if (static_cast<unsigned char>(c) < 0x20)
          fmt::format_to(std::back_inserter(out), "\\u{:04x}", static_cast<unsigned>(c));
        else
          out.push_back(c);
    }
  }
  out.push_back('"');
}

class JsonWriter {
 public:
  Result<std::string> write(const Value& root) {
    if (!writeValue(root, 0, 0)) return *failure_;
    out_.push_back('\n');
    return std::move(out_);
  }

 private:
  void indent(int level) { out_.append(static_cast<size_t>(level) * 2, ' '); }

  bool fail(std::string_view reason) {
    failure_ = document::documentError(DocumentErrorCode::Unrepresentable,
                                       fmt::format("{} at {}", reason, path_.text()));
    return false;
  }

  bool writeValue(const Value& v, int level, int depth) {
    switch (v.kind()) {
      case Value::Kind::Null: out_ += "null"; return true;
      case Value::Kind::Bool: out_ += *v.boolean() ? "true" : "false"; return true;
      case Value::Kind::Int: fmt::format_to(std::back_inserter(out_), "{}", *v.int64()); return true;
      case Value::Kind::UInt: fmt::format_to(std::back_inserter(out_), "{}", *v.uint64()); return true;
      case Value::Kind::Double: return writeReal(*v.real());
      case Value::Kind::String: return writeString(*v.string());
      case Value::Kind::Data: return writeString(encodeBase64(*v.data()));
      case Value::Kind::Date:
        if (!hasISO8601Form(*v.date()))
          return fail(fmt::format("date ({} s since 1970) has no ISO 8601 form", v.date()->secondsSince1970));
        return writeString(formatISO8601(*v.date()));
      case Value::Kind::UUID: return writeString(v.uuid()->string());
      case Value::Kind::Array: return writeArray(*v.array(), level, depth + 1);
      case Value::Kind::Dictionary: return writeObject(*v.dictionary(), level, depth + 1);
    }
    return fail("unknown kind of value");
  }

  // The shortest text that reads back to d, with ".0" added when it would
  // otherwise look like an integer, so that it reads back as a real.
  bool writeReal(double d) {
    if (!std::isfinite(d)) return fail(fmt::format("real {} has no JSON form", d));
    char buffer[32];
    const auto result = std::to_chars(buffer, buffer + sizeof buffer, d);
    const std::string_view text(buffer, static_cast<size_t>(result.ptr - buffer));
    out_ += text;
    if (text.find_first_of(".e") == std::string_view::npos) out_ += ".0";
    return true;
  }

  bool writeString(std::string_view s) {
    if (firstInvalidUtf8(s) != s.size()) return fail("string that is not valid UTF-8");
    appendQuotedUtf8(out_, s);
    return true;
  }

  bool checkDepth(int depth) {
    return depth <= kMaxDocumentDepth || fail(fmt::format("containers nested deeper than {}", kMaxDocumentDepth));
  }

  bool writeArray(const Array& array, int level, int depth) {
    if (!checkDepth(depth)) return false;
    if (array.empty()) {
      out_ += "[]";
      return true;
    }
    out_ += "[\n";
    for (size_t i = 0; i < array.size(); ++i) {
      path_.pushIndex(i);
      indent(level + 1);
      if (!writeValue(array[i], level + 1, depth)) return false;
      out_ += i + 1 < array.size() ? ",\n" : "\n";
      path_.pop();
    }
    indent(level);
    out_.push_back(']');
    return true;
  }

  bool writeObject(const Dictionary& object, int level, int depth) {
    if (!checkDepth(depth)) return false;
    if (object.empty()) {
      out_ += "{}";
      return true;
    }
    out_ += "{\n";
    size_t remaining = object.size();
    for (const auto& [key, value] : object) {
      path_.pushKey(key);
      indent(level + 1);
      if (firstInvalidUtf8(key) != key.size()) return fail("key that is not valid UTF-8");
      appendQuotedUtf8(out_, key);
      out_ += ": ";
      if (!writeValue(value, level + 1, depth)) return false;
      out_ += --remaining > 0 ? ",\n" : "\n";
      path_.pop();
    }
    indent(level);
    out_.push_back('}');
    return true;
  }

  std::string out_;
  ValuePath path_;
  std::optional<Error> failure_;
};

}  // namespace

Result<std::string> writeJsonDocument(const Value& value) { return JsonWriter().write(value); }

}  // namespace tn
