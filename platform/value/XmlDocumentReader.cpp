// The XML reader: Tenon's document vocabulary (see docs/documents.md),
// parsed by pugixml after XmlPrescan has refused what pugixml would let
// through, then walked element by element into a tn::Value. Every
// rejection names the line of the node at fault, from pugixml's offsets
// into the input.

#include <algorithm>
#include <cctype>
#include <charconv>
#include <cstring>
#include <exception>
#include <initializer_list>
#include <limits>
#include <optional>
#include <type_traits>
#include <utility>

#include <fmt/format.h>
#include <pugixml.hpp>

#include "platform/value/Base64.h"
#include "platform/value/DocumentReaders.h"
#include "platform/value/XmlPrescan.h"

namespace tn::document {
namespace {

enum class Element { Unknown, Root, Map, Item, List, Str, Int, UInt, Real, Bool, Data, Date, UUID, Null };

Element elementNamed(std::string_view name) {
  static constexpr std::pair<std::string_view, Element> kNames[] = {
      {"map", Element::Map},   {"item", Element::Item}, {"str", Element::Str},   {"int", Element::Int},
      {"list", Element::List}, {"uint", Element::UInt}, {"real", Element::Real}, {"bool", Element::Bool},
      {"data", Element::Data}, {"date", Element::Date}, {"uuid", Element::UUID}, {"null", Element::Null},
      {"tenon-document", Element::Root}};
  for (const auto& [n, e] : kNames)
    if (n == name) return e;
  return Element::Unknown;
}

bool isText(const pugi::xml_node& node) {
  return node.type() == pugi::node_pcdata || node.type() == pugi::node_cdata;
}

bool isWhitespace(std::string_view text) {
  return std::all_of(text.begin(), text.end(), isDocumentWhitespace);
}

std::string_view trimmed(std::string_view text) {
  while (!text.empty() && isDocumentWhitespace(text.front())) text.remove_prefix(1);
  while (!text.empty() && isDocumentWhitespace(text.back())) text.remove_suffix(1);
  return text;
}

bool equalsIgnoringCase(std::string_view a, std::string_view b) {
  return a.size() == b.size() &&
         std::equal(a.begin(), a.end(), b.begin(), [](char x, char y) {
           return std::tolower(static_cast<unsigned char>(x)) == std::tolower(static_cast<unsigned char>(y));
         });
}

// How a number's text failed to parse.
enum class NumberProblem { None, Malformed, OutOfRange };

// Parses all of text as a Number (no sign for unsigned, no '+', no spaces).
template <typename Number>
NumberProblem parseNumberText(std::string_view text, Number& out) {
  if (text.empty()) return NumberProblem::Malformed;
  const auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), out);
  if (ec == std::errc::result_out_of_range && end == text.data() + text.size()) return NumberProblem::OutOfRange;
  if (ec != std::errc() || end != text.data() + text.size()) return NumberProblem::Malformed;
  return NumberProblem::None;
}

NumberProblem parseReal(std::string_view text, double& out) {
  if (text == "nan") out = std::numeric_limits<double>::quiet_NaN();
  else if (text == "inf") out = std::numeric_limits<double>::infinity();
  else if (text == "-inf") out = -std::numeric_limits<double>::infinity();
  else if (text.empty() || text.find_first_not_of("0123456789.eE+-") != std::string_view::npos)
    return NumberProblem::Malformed;  // from_chars would take "infinity", "nan(1)", ...
  else return parseNumberText(text, out);
  return NumberProblem::None;
}

// The pugixml options: keep whitespace-only text (a <str> may hold only
// spaces), normalise line ends and attribute whitespace as XML requires,
// and parse as a fragment so that text outside the root element reaches
// the walk (which refuses it) instead of being skipped.
constexpr unsigned kParseOptions = pugi::parse_escapes | pugi::parse_eol | pugi::parse_wconv_attribute |
                                   pugi::parse_cdata | pugi::parse_ws_pcdata | pugi::parse_fragment |
                                   pugi::parse_declaration;

class XmlWalk {
 public:
  explicit XmlWalk(const DocumentInput& input) : input_(input) {}

  Result<Value> readDocument(const pugi::xml_document& document) {
    Value root;
    if (!readTopLevel(document, root)) return *error_;
    return root;
  }

 private:
  size_t offsetOf(const pugi::xml_node& node) const {
    const ptrdiff_t offset = node.offset_debug();
    return offset < 0 ? input_.bytes().size() : static_cast<size_t>(offset);
  }

  bool fail(const pugi::xml_node& at, std::string_view reason, DocumentErrorCode code = DocumentErrorCode::Invalid) {
    return failAt(offsetOf(at), reason, code);
  }

  bool failAt(size_t offset, std::string_view reason, DocumentErrorCode code = DocumentErrorCode::Invalid) {
    error_ = input_.errorAt(offset, code, reason);
    return false;
  }

  // Non-whitespace text where only elements belong; the error names the
  // line where the text itself starts, not where its node does.
  bool failText(const pugi::xml_node& text, std::string_view where) {
    return failAt(input_.skipWhitespace(offsetOf(text)), fmt::format("text not allowed in {}", where));
  }

  bool readTopLevel(const pugi::xml_document& document, Value& out) {
    pugi::xml_node root;
    for (const pugi::xml_node& node : document.children()) {
      if (node.type() == pugi::node_declaration) {
        if (!checkDeclaration(node)) return false;
      } else if (node.type() == pugi::node_element) {
        if (root) return fail(node, "more than one root element");
        root = node;
      } else if (isText(node) && !isWhitespace(node.value())) {
        return failText(node, "the document outside the root element");
      }
    }
    if (!root) return failAt(0, "no <tenon-document> element");
    if (elementNamed(root.name()) != Element::Root)
      return fail(root, fmt::format("root element must be <tenon-document>, not <{}>", root.name()));
    if (!checkAttributes(root, {"version"})) return false;
    const pugi::xml_attribute version = root.attribute("version");
    if (!version) return fail(root, "<tenon-document> without version");
    if (std::strcmp(version.value(), "1") != 0)
      return fail(root, fmt::format("unsupported document version {}", quotedForMessage(version.value())));
    pugi::xml_node value;
    return onlyValueIn(root, "<tenon-document>", value) && readValue(value, 0, out);
  }

  bool checkDeclaration(const pugi::xml_node& declaration) {
    // Its name follows "<?" at the very start, or it is no declaration.
    if (offsetOf(declaration) != 2) return fail(declaration, "the XML declaration must come first");
    for (const pugi::xml_attribute& a : declaration.attributes()) {
      const std::string_view name = a.name(), value = a.value();
      if (name == "version" && value != "1.0")
        return fail(declaration, fmt::format("unsupported XML version {}", quotedForMessage(value)));
      if (name == "encoding" && !equalsIgnoringCase(value, "UTF-8"))
        return fail(declaration, fmt::format("unsupported encoding {} (documents are UTF-8)", quotedForMessage(value)));
      if (name != "version" && name != "encoding" && name != "standalone")
        return fail(declaration, fmt::format("unknown attribute {} in the XML declaration", name));
    }
    return true;
  }

  // Refuses attributes other than the allowed ones, and any given twice.
  bool checkAttributes(const pugi::xml_node& element, std::initializer_list<std::string_view> allowed) {
    for (pugi::xml_attribute a = element.first_attribute(); a; a = a.next_attribute()) {
      const std::string_view name = a.name();
      if (std::find(allowed.begin(), allowed.end(), name) == allowed.end())
        return fail(element, fmt::format("unknown attribute {} on <{}>", name, element.name()));
      for (pugi::xml_attribute b = element.first_attribute(); b != a; b = b.next_attribute())
        if (name == b.name()) return fail(element, fmt::format("duplicate attribute {} on <{}>", name, element.name()));
    }
    return true;
  }

  // The one element inside parent (which may hold whitespace around it).
  bool onlyValueIn(const pugi::xml_node& parent, std::string_view what, pugi::xml_node& value) {
    for (const pugi::xml_node& child : parent.children()) {
      if (isText(child)) {
        if (!isWhitespace(child.value())) return failText(child, what);
      } else if (child.type() == pugi::node_element) {
        if (value) return fail(child, fmt::format("{} holds more than one value", what));
        value = child;
      }
    }
    if (!value) return fail(parent, fmt::format("{} holds no value", what));
    return true;
  }

  // Reads a value element; depth counts the containers around it.
  bool readValue(const pugi::xml_node& element, int depth, Value& out) {
    const Element kind = elementNamed(element.name());
    switch (kind) {
      case Element::Map: return readMap(element, depth + 1, out);
      case Element::List: return readList(element, depth + 1, out);
      case Element::Unknown: return fail(element, fmt::format("unknown element <{}>", element.name()));
      case Element::Item: return fail(element, "<item> outside a <map>");
      case Element::Root: return fail(element, "<tenon-document> inside a document");
      default: return readScalar(element, kind, out);
    }
  }

  bool checkDepth(const pugi::xml_node& container, int depth) {
    if (depth <= kMaxDocumentDepth) return true;
    return fail(container, fmt::format("containers nested deeper than {}", kMaxDocumentDepth),
                DocumentErrorCode::TooDeep);
  }

  bool readList(const pugi::xml_node& list, int depth, Value& out) {
    if (!checkDepth(list, depth) || !checkAttributes(list, {})) return false;
    Array elements;
    for (const pugi::xml_node& child : list.children()) {
      if (isText(child)) {
        if (!isWhitespace(child.value())) return failText(child, "<list>");
        continue;
      }
      Value element;
      if (!readValue(child, depth, element)) return false;
      elements.push_back(std::move(element));
    }
    out = Value(std::move(elements));
    return true;
  }

  bool readMap(const pugi::xml_node& map, int depth, Value& out) {
    if (!checkDepth(map, depth) || !checkAttributes(map, {})) return false;
    Dictionary entries;
    for (const pugi::xml_node& child : map.children()) {
      if (isText(child)) {
        if (!isWhitespace(child.value())) return failText(child, "<map>");
        continue;
      }
      const Element kind = elementNamed(child.name());
      if (kind == Element::Unknown) return fail(child, fmt::format("unknown element <{}>", child.name()));
      if (kind != Element::Item) return fail(child, fmt::format("<{}> in <map> must be inside an <item>", child.name()));
      std::string key;
      Value value;
      if (!readItem(child, depth, key, value)) return false;
      if (entries.find(key)) return fail(child, fmt::format("duplicate key {}", quotedForMessage(key)));
      entries.insertNew(std::move(key), std::move(value));
    }
    out = Value(std::move(entries));
    return true;
  }

  bool readItem(const pugi::xml_node& item, int depth, std::string& key, Value& value) {
    if (!checkAttributes(item, {"key", "key-base64"}) || !readKey(item, key)) return false;
    pugi::xml_node element;
    return onlyValueIn(item, fmt::format("item {}", quotedForMessage(key)), element) &&
           readValue(element, depth, value);
  }

  bool readKey(const pugi::xml_node& item, std::string& key) {
    const pugi::xml_attribute plain = item.attribute("key");
    const pugi::xml_attribute encoded = item.attribute("key-base64");
    if (plain && encoded) return fail(item, "<item> with both key and key-base64");
    if (plain) {
      key = plain.value();
      return true;
    }
    if (!encoded) return fail(item, "<item> without key");
    std::optional<std::string> decoded = decodeBase64ToString(encoded.value());
    if (!decoded) return fail(item, "bad base64 in key-base64");
    key = std::move(*decoded);
    return true;
  }

  // The character data of a scalar element: its text and CDATA children
  // joined. Elements inside are refused.
  bool textOf(const pugi::xml_node& element, std::string& text) {
    for (const pugi::xml_node& child : element.children()) {
      if (isText(child))
        text += child.value();
      else if (child.type() == pugi::node_element)
        return fail(child, fmt::format("unexpected element <{}> in <{}>", child.name(), element.name()));
    }
    return true;
  }

  bool readScalar(const pugi::xml_node& element, Element kind, Value& out) {
    if (!checkAttributes(element, kind == Element::Str ? std::initializer_list<std::string_view>{"encoding"}
                                                       : std::initializer_list<std::string_view>{}))
      return false;
    std::string text;
    if (!textOf(element, text)) return false;
    switch (kind) {
      case Element::Str: return readString(element, std::move(text), out);
      case Element::Int: return readNumber<int64_t>(element, trimmed(text), "integer", out);
      case Element::UInt: return readNumber<uint64_t>(element, trimmed(text), "unsigned integer", out);
      case Element::Real: return readNumber<double>(element, trimmed(text), "real", out);
      case Element::Bool: return readBool(element, trimmed(text), out);
      case Element::Data: return readData(element, text, out);
      case Element::Date: return readDate(element, trimmed(text), out);
      case Element::UUID: return readUUID(element, trimmed(text), out);
      case Element::Null:
        if (!isWhitespace(text)) return fail(element, "<null> must be empty");
        out = Value();
        return true;
      default: return fail(element, fmt::format("unexpected element <{}>", element.name()));
    }
  }

  bool readString(const pugi::xml_node& element, std::string text, Value& out) {
    const pugi::xml_attribute encoding = element.attribute("encoding");
    if (!encoding) {
      out = Value(std::move(text));
      return true;
    }
    if (std::strcmp(encoding.value(), "base64") != 0)
      return fail(element, fmt::format("unknown string encoding {}", quotedForMessage(encoding.value())));
    std::optional<std::string> decoded = decodeBase64ToString(text);
    if (!decoded) return fail(element, "bad base64 in <str>");
    out = Value(std::move(*decoded));
    return true;
  }

  template <typename Number>
  bool readNumber(const pugi::xml_node& element, std::string_view text, std::string_view what, Value& out) {
    Number n{};
    const NumberProblem problem = [&] {
      if constexpr (std::is_same_v<Number, double>) return parseReal(text, n);
      else return parseNumberText(text, n);
    }();
    if (problem == NumberProblem::Malformed) return fail(element, fmt::format("bad {} {}", what, quotedForMessage(text)));
    if (problem == NumberProblem::OutOfRange)
      return fail(element, fmt::format("{} {} out of range", what, quotedForMessage(text)));
    out = Value(n);
    return true;
  }

  bool readBool(const pugi::xml_node& element, std::string_view text, Value& out) {
    if (text != "true" && text != "false")
      return fail(element, fmt::format("bad boolean {} (true or false)", quotedForMessage(text)));
    out = Value(text == "true");
    return true;
  }

  bool readData(const pugi::xml_node& element, std::string_view text, Value& out) {
    std::optional<Bytes> bytes = decodeBase64(text);
    if (!bytes) return fail(element, "bad base64 in <data>");
    out = Value(std::move(*bytes));
    return true;
  }

  bool readDate(const pugi::xml_node& element, std::string_view text, Value& out) {
    const std::optional<Date> date = parseISO8601(text);
    // A date beyond the range of the text form could never be written back.
    if (!date || !hasISO8601Form(*date))
      return fail(element, fmt::format("bad date {} (ISO 8601 in UTC, like 2026-11-22T20:53:00Z)",
                                       quotedForMessage(text)));
    out = Value(*date);
    return true;
  }

  bool readUUID(const pugi::xml_node& element, std::string_view text, Value& out) {
    const std::optional<UUID> uuid = UUID::parse(text);
    if (!uuid) return fail(element, fmt::format("bad UUID {}", quotedForMessage(text)));
    out = Value(*uuid);
    return true;
  }

  const DocumentInput& input_;
  std::optional<Error> error_;
};

// pugixml's status text as a reason: "malformed XML: start-end tags mismatch".
std::string parseFailureReason(const pugi::xml_parse_result& result, size_t inputSize) {
  // pugixml reports open elements at the end as a mismatch at the last byte.
  if (result.status == pugi::status_end_element_mismatch && static_cast<size_t>(result.offset) + 1 >= inputSize)
    return "malformed XML: the document ends inside an element";
  std::string description = result.description();
  if (!description.empty()) description[0] = static_cast<char>(std::tolower(static_cast<unsigned char>(description[0])));
  return "malformed XML: " + description;
}

}  // namespace

Result<Value> readXmlDocument(const DocumentInput& input) {
  if (Result<void> clean = prescanXml(input); !clean) return clean.error();
  try {
    pugi::xml_document document;
    const std::string_view bytes = input.bytes();
    const pugi::xml_parse_result parsed =
        document.load_buffer(bytes.data(), bytes.size(), kParseOptions, pugi::encoding_utf8);
    if (!parsed)
      return input.errorAt(static_cast<size_t>(std::max<ptrdiff_t>(parsed.offset, 0)), DocumentErrorCode::Malformed,
                           parseFailureReason(parsed, bytes.size()));
    return XmlWalk(input).readDocument(document);
  } catch (const std::exception& e) {
    // pugixml and the walk allocate; nothing else throws.
    return input.errorAt(0, DocumentErrorCode::Malformed, fmt::format("cannot read: {}", e.what()));
  }
}

}  // namespace tn::document
