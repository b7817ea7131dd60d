// Every way an XML document can be wrong, and the exact "name:line: reason"
// each one gives. Documents are untrusted: none of these may crash, expand
// anything, or be accepted.

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "platform/value/Document.h"

namespace tn {
namespace {

using namespace std::string_literals;
using Code = DocumentErrorCode;

// A document whose value element starts on line 2.
std::string document(const std::string& body) {
  return "<tenon-document version=\"1\">\n" + body + "\n</tenon-document>\n";
}

std::string nestedLists(int depth) {
  std::string s;
  for (int i = 0; i < depth; ++i) s += "<list>";
  for (int i = 0; i < depth; ++i) s += "</list>";
  return s;
}

struct HostileCase {
  const char* what;
  std::string xml;
  std::string message;  // after "Info.manifest:"
  Code code;
};

void expectRefused(const HostileCase& c) {
  Result<Value> read = readDocument(c.xml, "Info.manifest");
  ASSERT_FALSE(read) << c.what << " was accepted as " << read->description();
  EXPECT_EQ(read.error().localizedDescription(), "Info.manifest:" + c.message) << c.what;
  EXPECT_EQ(read.error().domain(), kDocumentErrorDomain);
  EXPECT_TRUE(isDocumentError(read.error(), c.code)) << c.what << ": code " << read.error().code();
}

TEST(XmlHostileInput, StructureOutsideTheVocabularyIsRefusedWithItsLine) {
  const HostileCase cases[] = {
      {"misspelt element",
       "<?xml version=\"1.0\"?>\n<tenon-document version=\"1\">\n<map>\n  <item key=\"a\"><strng>x</strng></item>\n"
       "</map>\n</tenon-document>\n",
       "4: unknown element <strng>", Code::Invalid},
      {"wrong root", "<document version=\"1\"><null/></document>",
       "1: root element must be <tenon-document>, not <document>", Code::Invalid},
      {"root without version", "<tenon-document>\n<null/>\n</tenon-document>", "1: <tenon-document> without version",
       Code::Invalid},
      {"future version", "<tenon-document version=\"2\"><null/></tenon-document>",
       "1: unsupported document version \"2\"", Code::Invalid},
      {"unknown root attribute", "<tenon-document version=\"1\" xmlns=\"x\"><null/></tenon-document>",
       "1: unknown attribute xmlns on <tenon-document>", Code::Invalid},
      {"empty root", "<tenon-document version=\"1\">\n\n</tenon-document>", "1: <tenon-document> holds no value",
       Code::Invalid},
      {"two values in root", document("<null/>\n<null/>"), "3: <tenon-document> holds more than one value",
       Code::Invalid},
      {"text in root", document("<null/>\n  stray"), "3: text not allowed in <tenon-document>", Code::Invalid},
      {"no root at all", "<?xml version=\"1.0\"?>\n", "1: no <tenon-document> element", Code::Invalid},
      {"two roots", document("<null/>") + document("<null/>"), "4: more than one root element", Code::Invalid},
      {"text after the root", document("<null/>") + "\ntrailing", "5: text not allowed in the document outside the root element",
       Code::Invalid},
      {"item without key", document("<map>\n<item><null/></item>\n</map>"), "3: <item> without key", Code::Invalid},
      {"item with both keys", document("<map>\n<item key=\"a\" key-base64=\"YQ==\"><null/></item>\n</map>"),
       "3: <item> with both key and key-base64", Code::Invalid},
      {"item with an unknown attribute", document("<map>\n<item key=\"a\" type=\"int\"><int>1</int></item>\n</map>"),
       "3: unknown attribute type on <item>", Code::Invalid},
      {"item given a key twice", document("<map>\n<item key=\"a\" key=\"b\"><null/></item>\n</map>"),
       "3: duplicate attribute key on <item>", Code::Invalid},
      {"item holding nothing", document("<map>\n<item key=\"a\">\n</item>\n</map>"), "3: item \"a\" holds no value",
       Code::Invalid},
      {"item holding two values", document("<map>\n<item key=\"a\">\n<int>1</int>\n<int>2</int></item>\n</map>"),
       "5: item \"a\" holds more than one value", Code::Invalid},
      {"text in an item", document("<map><item key=\"a\"><int>1</int>x</item></map>"), "2: text not allowed in item \"a\"",
       Code::Invalid},
      {"text in a map, named at its own line", document("<map>\n\n   oops\n</map>"), "4: text not allowed in <map>",
       Code::Invalid},
      {"CDATA text in a list", document("<list>\n<![CDATA[x]]></list>"), "3: text not allowed in <list>", Code::Invalid},
      {"value directly in a map", document("<map>\n<str>x</str>\n</map>"), "3: <str> in <map> must be inside an <item>",
       Code::Invalid},
      {"item in a list", document("<list>\n<item key=\"a\"><null/></item>\n</list>"), "3: <item> outside a <map>",
       Code::Invalid},
      {"nested root element", document("<list><tenon-document version=\"1\"/></list>"),
       "2: <tenon-document> inside a document", Code::Invalid},
      {"duplicate key", document("<map>\n<item key=\"a\"><null/></item>\n<item key=\"a\"><null/></item>\n</map>"),
       "4: duplicate key \"a\"", Code::Invalid},
      {"duplicate key, once base64", document("<map>\n<item key=\"a\"><null/></item>\n<item key-base64=\"YQ==\"><null/></item>\n</map>"),
       "4: duplicate key \"a\"", Code::Invalid},
      {"element inside a scalar", document("<str>a<b>bold</b></str>"), "2: unexpected element <b> in <str>",
       Code::Invalid},
      {"attribute on a scalar", document("<int base=\"16\">10</int>"), "2: unknown attribute base on <int>",
       Code::Invalid},
      {"attribute on a container", document("<map kind=\"x\"/>"), "2: unknown attribute kind on <map>", Code::Invalid},
      {"null with text", document("<null>0</null>"), "2: <null> must be empty", Code::Invalid},
      {"too deep", document(nestedLists(65)),
       "2: containers nested deeper than 64", Code::TooDeep},
  };
  for (const HostileCase& c : cases) expectRefused(c);
}

TEST(XmlHostileInput, BadScalarsAreRefusedQuotingTheText) {
  const HostileCase cases[] = {
      {"trailing junk", document("<int>12x</int>"), "2: bad integer \"12x\"", Code::Invalid},
      {"plus sign", document("<int>+1</int>"), "2: bad integer \"+1\"", Code::Invalid},
      {"empty int", document("<int/>"), "2: bad integer \"\"", Code::Invalid},
      {"int above range", document("<int>9223372036854775808</int>"), "2: integer \"9223372036854775808\" out of range",
       Code::Invalid},
      {"int below range", document("<int>-9223372036854775809</int>"),
       "2: integer \"-9223372036854775809\" out of range", Code::Invalid},
      {"negative uint", document("<uint>-1</uint>"), "2: bad unsigned integer \"-1\"", Code::Invalid},
      {"uint above range", document("<uint>18446744073709551616</uint>"),
       "2: unsigned integer \"18446744073709551616\" out of range", Code::Invalid},
      {"two points", document("<real>1.2.3</real>"), "2: bad real \"1.2.3\"", Code::Invalid},
      {"spelled infinity", document("<real>infinity</real>"), "2: bad real \"infinity\"", Code::Invalid},
      {"hex real", document("<real>0x1p3</real>"), "2: bad real \"0x1p3\"", Code::Invalid},
      {"real overflow", document("<real>1e400</real>"), "2: real \"1e400\" out of range", Code::Invalid},
      {"capitalised bool", document("<bool>True</bool>"), "2: bad boolean \"True\" (true or false)", Code::Invalid},
      {"numeric bool", document("<bool>1</bool>"), "2: bad boolean \"1\" (true or false)", Code::Invalid},
      {"base64 without padding", document("<data>3q2+7w</data>"), "2: bad base64 in <data>", Code::Invalid},
      {"base64 with a stray character", document("<data>3q2*7w==</data>"), "2: bad base64 in <data>", Code::Invalid},
      {"base64 padding in the middle", document("<data>3q==7w==</data>"), "2: bad base64 in <data>", Code::Invalid},
      {"base64 string", document("<str encoding=\"base64\">!!</str>"), "2: bad base64 in <str>", Code::Invalid},
      {"unknown string encoding", document("<str encoding=\"hex\">41</str>"), "2: unknown string encoding \"hex\"",
       Code::Invalid},
      {"base64 key", document("<map><item key-base64=\"Y\"><null/></item></map>"), "2: bad base64 in key-base64",
       Code::Invalid},
      {"month 13", document("<date>2026-13-01T00:00:00Z</date>"),
       "2: bad date \"2026-13-01T00:00:00Z\" (ISO 8601 in UTC, like 2026-11-22T20:53:00Z)", Code::Invalid},
      {"date with an offset", document("<date>2026-11-22T20:53:00+01:00</date>"),
       "2: bad date \"2026-11-22T20:53:00+01:00\" (ISO 8601 in UTC, like 2026-11-22T20:53:00Z)", Code::Invalid},
      {"date beyond the text form", document("<date>+999999999-01-01T00:00:00Z</date>"),
       "2: bad date \"+999999999-01-01T00:00:00Z\" (ISO 8601 in UTC, like 2026-11-22T20:53:00Z)", Code::Invalid},
      {"short UUID", document("<uuid>E621E1F8-C36C-495A-93FC</uuid>"), "2: bad UUID \"E621E1F8-C36C-495A-93FC\"",
       Code::Invalid},
      {"long text is cut in the message", document("<int>" + std::string(100, '7') + "x</int>"),
       "2: bad integer \"" + std::string(60, '7') + "...\"", Code::Invalid},
  };
  for (const HostileCase& c : cases) expectRefused(c);
}

TEST(XmlHostileInput, NoEntityIsEverDeclaredOrExpanded) {
  const HostileCase cases[] = {
      {"billion laughs",
       "<?xml version=\"1.0\"?>\n<!DOCTYPE lolz [\n <!ENTITY lol \"lol\">\n <!ENTITY lol2 \"&lol;&lol;&lol;\">\n]>\n"
       "<tenon-document version=\"1\"><str>&lol2;</str></tenon-document>",
       "2: DOCTYPE declarations are not allowed", Code::Malformed},
      {"external entity", "<!DOCTYPE x SYSTEM \"file:///etc/passwd\"><tenon-document version=\"1\"/>",
       "1: DOCTYPE declarations are not allowed", Code::Malformed},
      {"bare entity declaration", document("<!ENTITY a \"b\"><null/>"), "2: markup declarations are not allowed",
       Code::Malformed},
      {"undeclared entity in text", document("<str>\n&foo;</str>"), "3: unknown entity &foo;", Code::Malformed},
      {"undeclared entity in a key", document("<map><item key=\"&nbsp;\"><null/></item></map>"),
       "2: unknown entity &nbsp;", Code::Malformed},
      {"bare ampersand", document("<str>fish & chips</str>"), "2: '&' that does not begin a reference (write &amp;)",
       Code::Malformed},
      {"ampersand without semicolon", document("<str>&amp</str>"),
       "2: '&' that does not begin a reference (write &amp;)", Code::Malformed},
      {"reference to NUL", document("<str>&#0;</str>"), "2: character reference &#0; is not an XML character",
       Code::Malformed},
      {"reference to a control character", document("<str>&#x1B;</str>"),
       "2: character reference &#x1B; is not an XML character", Code::Malformed},
      {"reference to a surrogate", document("<str>&#xD800;</str>"),
       "2: character reference &#xD800; is not an XML character", Code::Malformed},
      {"reference beyond Unicode", document("<str>&#1114112;</str>"),
       "2: character reference &#1114112; is not an XML character", Code::Malformed},
      {"huge reference", document("<str>&#99999999999999999999;</str>"),
       "2: character reference &#99999999999999999999; is not an XML character", Code::Malformed},
      {"malformed reference", document("<str>&#x;</str>"), "2: malformed character reference &#x;", Code::Malformed},
      {"upper-case X", document("<str>&#X41;</str>"), "2: malformed character reference &#X41;", Code::Malformed},
  };
  for (const HostileCase& c : cases) expectRefused(c);
}

TEST(XmlHostileInput, BytesThatAreNotXmlTextAreRefusedWhereverTheyAre) {
  const HostileCase cases[] = {
      {"invalid UTF-8 in text", document("<list>\n<str>ok</str>\n<str>\xff</str></list>"), "4: invalid UTF-8",
       Code::Malformed},
      {"invalid UTF-8 in a comment", document("<!-- \xC3 -->\n<null/>"), "2: invalid UTF-8", Code::Malformed},
      {"invalid UTF-8 in an attribute", document("<map><item key=\"\xE2\x82\"><null/></item></map>"),
       "2: invalid UTF-8", Code::Malformed},
      {"invalid UTF-8 in a tag name", document("<n\xffll/>"), "2: invalid UTF-8", Code::Malformed},
      {"overlong slash", document("<str>\xC0\xAF</str>"), "2: invalid UTF-8", Code::Malformed},
      {"encoded surrogate", document("<str>\xED\xA0\x80</str>"), "2: invalid UTF-8", Code::Malformed},
      {"truncated at the end", document("<null/>") + "\xF0\x9F", "4: invalid UTF-8", Code::Malformed},
      {"raw NUL", document("<str>a\0b</str>"s), "2: character U+0000 is not allowed in XML", Code::Malformed},
      {"raw escape character", document("\n<str>\x1b[0m</str>"), "3: character U+001B is not allowed in XML",
       Code::Malformed},
      {"U+FFFE", document("<str>\xEF\xBF\xBE</str>"), "2: character U+FFFE is not allowed in XML", Code::Malformed},
      {"'<' in an attribute value", document("<map><item key=\"a<b\"><null/></item></map>"),
       "2: '<' in an attribute value (write &lt;)", Code::Malformed},
  };
  for (const HostileCase& c : cases) expectRefused(c);
}

TEST(XmlHostileInput, MalformedXmlAndDeclarationsAreRefused) {
  const HostileCase cases[] = {
      {"mismatched end tag", document("<map>\n</list>"), "3: malformed XML: start-end tags mismatch", Code::Malformed},
      {"unclosed elements", "<tenon-document version=\"1\">\n<map>\n", "2: malformed XML: the document ends inside an element",
       Code::Malformed},
      {"broken attribute", document("<map><item key=a><null/></item></map>"),
       "2: malformed XML: error parsing element attribute", Code::Malformed},
      {"XML 1.1", "<?xml version=\"1.1\"?><tenon-document version=\"1\"><null/></tenon-document>",
       "1: unsupported XML version \"1.1\"", Code::Invalid},
      {"Latin-1", "<?xml version=\"1.0\" encoding=\"ISO-8859-1\"?>\n<tenon-document version=\"1\"><null/></tenon-document>",
       "1: unsupported encoding \"ISO-8859-1\" (documents are UTF-8)", Code::Invalid},
      {"declaration not first", "\n<?xml version=\"1.0\"?><tenon-document version=\"1\"><null/></tenon-document>",
       "2: the XML declaration must come first", Code::Invalid},
  };
  for (const HostileCase& c : cases) expectRefused(c);
}

TEST(XmlHostileInput, PathologicalShapesEndInAnErrorNotACrash) {
  // Deep nesting of elements the walk never descends into, and of
  // containers past the limit: refused at the first offence, no recursion
  // beyond the depth limit.
  std::string deepUnknown;
  for (int i = 0; i < 200000; ++i) deepUnknown += "<x>";
  for (int i = 0; i < 200000; ++i) deepUnknown += "</x>";
  Result<Value> unknown = readDocument(document(deepUnknown), "deep.xml");
  ASSERT_FALSE(unknown);
  EXPECT_EQ(unknown.error().localizedDescription(), "deep.xml:2: unknown element <x>");

  Result<Value> lists = readDocument(document(nestedLists(100000)), "deep.xml");
  ASSERT_FALSE(lists);
  EXPECT_TRUE(isDocumentError(lists.error(), Code::TooDeep));

  // Containers at exactly the limit are fine.
  EXPECT_TRUE(readDocument(document(nestedLists(kMaxDocumentDepth)), "deep.xml"));

  // Many siblings are not a depth problem.
  std::string wide = "<list>";
  for (int i = 0; i < 100000; ++i) wide += "<null/>";
  wide += "</list>";
  Result<Value> read = readDocument(document(wide), "wide.xml");
  ASSERT_TRUE(read);
  EXPECT_EQ(read->array()->size(), 100000u);
}

}  // namespace
}  // namespace tn
