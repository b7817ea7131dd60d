// The XML writer: Tenon's document vocabulary, pretty-printed, lossless for
// every tn::Value (see docs/documents.md).

#include <iterator>
#include <optional>

#include <fmt/format.h>

#include "platform/value/Base64.h"
#include "platform/value/Document.h"
#include "platform/value/DocumentUtf8.h"
#include "platform/value/RealText.h"
#include "platform/value/ValuePath.h"

namespace tn {
namespace {

using document::ValuePath;

// Character data of <str>. '>' is escaped too so that "]]>" never appears,
// and CR as a reference because a reader turns a literal CR into LF.
void appendEscapedText(std::string& out, std::string_view text) {
  for (char c : text) {
    switch (c) {
      case '&': out += "&amp;"; break;
      case '<': out += "&lt;"; break;
      case '>': out += "&gt;"; break;
      case '\r': out += "&#13;"; break;
      default: out.push_back(c);
    }
  }
}

// An attribute value in double quotes. Tab, LF and CR are references
// because a reader replaces literal ones with spaces.
void appendEscapedAttribute(std::string& out, std::string_view text) {
  for (char c : text) {
    switch (c) {
      case '&': out += "&amp;"; break;
      case '<': out += "&lt;"; break;
      case '>': out += "&gt;"; break;
      case '"': out += "&quot;"; break;
      case '\t': out += "&#9;"; break;
      case '\n': out += "&#10;"; break;
      case '\r': out += "&#13;"; break;
      default: out.push_back(c);
    }
  }
}

bool isNonEmptyContainer(const Value& v) {
  if (const Array* a = v.array()) return !a->empty();
  if (const Dictionary* d = v.dictionary()) return !d->empty();
  return false;
}

class XmlWriter {
 public:
  Result<std::string> write(const Value& root) {
    out_ = "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<tenon-document version=\"1\">\n";
    indent(1);
    if (!writeValue(root, 1, 0)) return *failure_;
    out_ += "\n</tenon-document>\n";
    return std::move(out_);
  }

 private:
  void indent(int level) { out_.append(static_cast<size_t>(level) * 2, ' '); }

  bool fail(std::string_view reason) {
    failure_ = document::documentError(DocumentErrorCode::Unrepresentable,
                                       fmt::format("{} at {}", reason, path_.text()));
    return false;
  }

  // Writes v's element, whose start tag is at indentation level; depth
  // counts the containers around it.
  bool writeValue(const Value& v, int level, int depth) {
    switch (v.kind()) {
      case Value::Kind::Null: out_ += "<null/>"; return true;
      case Value::Kind::Bool: out_ += *v.boolean() ? "<bool>true</bool>" : "<bool>false</bool>"; return true;
      case Value::Kind::Int: fmt::format_to(std::back_inserter(out_), "<int>{}</int>", *v.int64()); return true;
      case Value::Kind::UInt: fmt::format_to(std::back_inserter(out_), "<uint>{}</uint>", *v.uint64()); return true;
      case Value::Kind::Double:
        out_ += "<real>";
        document::appendRealText(out_, *v.real());
        out_ += "</real>";
        return true;
      case Value::Kind::String: writeString(*v.string()); return true;
      case Value::Kind::Data: out_ += "<data>" + encodeBase64(*v.data()) + "</data>"; return true;
      case Value::Kind::Date: return writeDate(*v.date());
      case Value::Kind::UUID: out_ += "<uuid>" + v.uuid()->string() + "</uuid>"; return true;
      case Value::Kind::Array: return writeList(*v.array(), level, depth + 1);
      case Value::Kind::Dictionary: return writeMap(*v.dictionary(), level, depth + 1);
    }
    return fail("unknown kind of value");
  }

  void writeString(const std::string& s) {
    if (document::isXmlText(s)) {
      out_ += "<str>";
      appendEscapedText(out_, s);
      out_ += "</str>";
    } else {
      out_ += "<str encoding=\"base64\">" + encodeBase64(s) + "</str>";
    }
  }

  bool writeDate(Date date) {
    if (!hasISO8601Form(date)) return fail(fmt::format("date ({} s since 1970) has no ISO 8601 form", date.secondsSince1970));
    out_ += "<date>" + formatISO8601(date) + "</date>";
    return true;
  }

  bool writeList(const Array& list, int level, int depth) {
    if (depth > kMaxDocumentDepth) return fail(fmt::format("containers nested deeper than {}", kMaxDocumentDepth));
    if (list.empty()) {
      out_ += "<list/>";
      return true;
    }
    out_ += "<list>\n";
    for (size_t i = 0; i < list.size(); ++i) {
      path_.pushIndex(i);
      indent(level + 1);
      if (!writeValue(list[i], level + 1, depth)) return false;
      out_.push_back('\n');
      path_.pop();
    }
    indent(level);
    out_ += "</list>";
    return true;
  }

  bool writeMap(const Dictionary& map, int level, int depth) {
    if (depth > kMaxDocumentDepth) return fail(fmt::format("containers nested deeper than {}", kMaxDocumentDepth));
    if (map.empty()) {
      out_ += "<map/>";
      return true;
    }
    out_ += "<map>\n";
    for (const auto& [key, value] : map) {
      path_.pushKey(key);
      indent(level + 1);
      writeItemStart(key);
      // A non-empty container goes on lines of its own; anything else stays
      // on the item's line.
      if (isNonEmptyContainer(value)) {
        out_.push_back('\n');
        indent(level + 2);
        if (!writeValue(value, level + 2, depth)) return false;
        out_.push_back('\n');
        indent(level + 1);
      } else if (!writeValue(value, level + 1, depth)) {
        return false;
      }
      out_ += "</item>\n";
      path_.pop();
    }
    indent(level);
    out_ += "</map>";
    return true;
  }

  void writeItemStart(const std::string& key) {
    if (document::isXmlText(key)) {
      out_ += "<item key=\"";
      appendEscapedAttribute(out_, key);
    } else {
      out_ += "<item key-base64=\"" + encodeBase64(key);
    }
    out_ += "\">";
  }

  std::string out_;
  ValuePath path_;
  std::optional<Error> failure_;
};

}  // namespace

Result<std::string> writeXmlDocument(const Value& value) { return XmlWriter().write(value); }

}  // namespace tn
