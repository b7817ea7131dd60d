// The XML document encoding: lossless round trips, the exact written form,
// and hand-written documents.

#include <gtest/gtest.h>

#include <cmath>
#include <limits>

#include "platform/value/Document.h"
#include "tests/support/ValueGenerator.h"

namespace tn {
namespace {

using namespace std::string_literals;

Value readXml(std::string_view text) {
  Result<Value> read = readDocument(text, "test.xml", DocumentEncoding::Xml);
  EXPECT_TRUE(read) << read.error().localizedDescription() << "\n" << text;
  return read ? *read : Value();
}

// Write, read back, and demand the identical value and (since identical()
// ignores dictionary order) the identical text on a second write.
void expectRoundTrip(const Value& v) {
  Result<std::string> written = writeXmlDocument(v);
  ASSERT_TRUE(written) << written.error().localizedDescription();
  Result<Value> read = readDocument(*written, "round-trip.xml");
  ASSERT_TRUE(read) << read.error().localizedDescription() << "\n" << *written;
  EXPECT_TRUE(Value::identical(v, *read)) << v.description() << "\n" << read->description() << "\n" << *written;
  Result<std::string> rewritten = writeXmlDocument(*read);
  ASSERT_TRUE(rewritten);
  EXPECT_EQ(*written, *rewritten);
}

TEST(XmlDocument, GeneratedValuesOfEveryKindSurviveWriteAndRead) {
  test::ValueGenerator generator(20261122);
  for (int i = 0; i < 4000; ++i) {
    // Most roots of any() are scalars; every fourth value is a dictionary
    // so that nesting gets its share.
    expectRoundTrip(i % 4 == 0 ? generator.dictionary(5) : generator.any(5));
    if (HasFatalFailure() || HasNonfatalFailure()) return;
  }
}

TEST(XmlDocument, EdgeNumbersKeepTheirKindAndBits) {
  const double nan = std::numeric_limits<double>::quiet_NaN();
  const double inf = std::numeric_limits<double>::infinity();
  for (const Value& v : {Value(int64_t{0}), Value(uint64_t{0}), Value(std::numeric_limits<int64_t>::min()),
                         Value(std::numeric_limits<uint64_t>::max()), Value(-0.0), Value(nan), Value(inf),
                         Value(-inf), Value(5e-324), Value(0.1), Value(std::numeric_limits<double>::max()),
                         Value(9007199254740993.0), Value(false)})
    expectRoundTrip(v);
  // identical() cannot see the sign of zero.
  EXPECT_TRUE(std::signbit(*readXml(*writeXmlDocument(Value(-0.0))).real()));
  EXPECT_EQ(readXml(*writeXmlDocument(Value(uint64_t{5}))).kind(), Value::Kind::UInt);
  EXPECT_EQ(readXml(*writeXmlDocument(Value(int64_t{5}))).kind(), Value::Kind::Int);
}

TEST(XmlDocument, StringsAndKeysXmlCannotCarryAsTextSurvive) {
  const std::string awkward[] = {"",          " ",         "  lead and trail  ", "\t\n\r",    "a\r\nb",
                                 "a\rb",      "]]>",       "&amp;&lt;",          "\"'<>&",    std::string(1, '\0'),
                                 "nul\0in"s,  "\x01\x1f",  "\xff\xfe",           "\xC3",      "\xEF\xBF\xBE",
                                 "\xED\xA0\x80", "\xF0\x9F\x98\x80", "\x7f"};
  for (const std::string& s : awkward) {
    expectRoundTrip(Value(s));
    expectRoundTrip(Value(Dictionary{{s, Value(s)}}));
  }
  // Plain text stays readable; only what XML cannot hold is encoded.
  EXPECT_NE(writeXmlDocument(Value("a\tb\nc"))->find("<str>a\tb\nc</str>"), std::string::npos);
  EXPECT_NE(writeXmlDocument(Value(Dictionary{{"a\x01", 1}}))->find("<item key-base64=\"YQE=\">"), std::string::npos);
}

TEST(XmlDocument, DeepestAllowedNestingIsWrittenAndReadAndOneMoreIsRefused) {
  Value deepest = Value(Array{});
  for (int depth = 1; depth < kMaxDocumentDepth; ++depth)
    deepest = depth % 2 ? Value(Dictionary{{"k", deepest}}) : Value(Array{deepest});
  expectRoundTrip(deepest);

  Result<std::string> tooDeep = writeXmlDocument(Value(Array{deepest}));
  ASSERT_FALSE(tooDeep);
  EXPECT_TRUE(isDocumentError(tooDeep.error(), DocumentErrorCode::Unrepresentable));
  EXPECT_EQ(tooDeep.error().localizedDescription().rfind("containers nested deeper than 64 at [0][\"k\"][0]", 0), 0u)
      << tooDeep.error().localizedDescription();
}

TEST(XmlDocument, ADateWithoutTextFormIsAWriteErrorNamingWhere) {
  const Value v(Dictionary{{"data", Value(Array{Value(Date{1e300})})}});
  Result<std::string> written = writeXmlDocument(v);
  ASSERT_FALSE(written);
  EXPECT_TRUE(isDocumentError(written.error(), DocumentErrorCode::Unrepresentable));
  EXPECT_EQ(written.error().localizedDescription(), "date (1e+300 s since 1970) has no ISO 8601 form at [\"data\"][0]");
  EXPECT_FALSE(writeXmlDocument(Value(Date{std::numeric_limits<double>::quiet_NaN()})));
}

// The written form is an interface (files on disk, tools, people); it must
// not drift.
TEST(XmlDocument, WritesTheDocumentedForm) {
  const Value v(Dictionary{
      {"name", "Notes & <Share>"},
      {"count", Value(int64_t{-3})},
      {"size", Value(uint64_t{7})},
      {"ratio", 0.75},
      {"on", true},
      {"blob", Value(Bytes{0xde, 0xad, 0xbe, 0xef})},
      {"when", Value(Date{1795902780.25})},
      {"id", Value(*UUID::parse("E621E1F8-C36C-495A-93FC-0C247A3E6E5F"))},
      {"nothing", Value()},
      {"list", Value(Array{Value(1), Value(Array{}), Value(Dictionary{{"k", "v"}})})},
      {"empty", Value(Dictionary{})},
      {"tab\tkey \"q\"", "line1\r\nline2\x01"},
  });
  EXPECT_EQ(*writeXmlDocument(v), R"(<?xml version="1.0" encoding="UTF-8"?>
<tenon-document version="1">
  <map>
    <item key="name"><str>Notes &amp; &lt;Share&gt;</str></item>
    <item key="count"><int>-3</int></item>
    <item key="size"><uint>7</uint></item>
    <item key="ratio"><real>0.75</real></item>
    <item key="on"><bool>true</bool></item>
    <item key="blob"><data>3q2+7w==</data></item>
    <item key="when"><date>2026-11-28T21:53:00.25Z</date></item>
    <item key="id"><uuid>E621E1F8-C36C-495A-93FC-0C247A3E6E5F</uuid></item>
    <item key="nothing"><null/></item>
    <item key="list">
      <list>
        <int>1</int>
        <list/>
        <map>
          <item key="k"><str>v</str></item>
        </map>
      </list>
    </item>
    <item key="empty"><map/></item>
    <item key="tab&#9;key &quot;q&quot;"><str encoding="base64">bGluZTENCmxpbmUyAQ==</str></item>
  </map>
</tenon-document>
)");
  EXPECT_EQ(*writeXmlDocument(Value(0.1)),
            "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<tenon-document version=\"1\">\n  <real>0.1</real>\n"
            "</tenon-document>\n");
}

TEST(XmlDocument, ReadsAHandWrittenPlugInManifest) {
  // CRLF line ends, a byte order mark, comments, CDATA, wrapped base64,
  // whitespace around scalars and inside empty containers: what editors and
  // people produce.
  const std::string manifest =
      "\xEF\xBB\xBF<?xml version='1.0' encoding='utf-8' standalone='yes'?>\r\n"
      "<!-- Share to Notes -->\r\n"
      "<tenon-document version=\"1\">\r\n"
      "  <map>\r\n"
      "    <item key=\"BNBundleIdentifier\"><str>com.example.notes.share</str></item>\r\n"
      "    <item key=\"BNBundleVersion\"> <str>2.4.1</str> </item>\r\n"
      "    <item key=\"XTExtension\">\r\n"
      "      <map>\r\n"
      "        <item key=\"XTExtensionPointIdentifier\"><str>com.ostrel.share-services</str></item>\r\n"
      "        <item key=\"Summary\"><str><![CDATA[<b>\"text/plain\" & more</b>]]></str></item>\r\n"
      "        <item key=\"MaxItems\"><int> 10\r\n</int></item>\r\n"
      "        <item key=\"Ratio\"><real>0.75</real></item>\r\n"
      "        <item key=\"Beta\"><bool>false</bool></item>\r\n"
      "      </map>\r\n"
      "    </item>\r\n"
      "    <item key=\"Icon\"><data>\r\n      3q2+\r\n      7w==\r\n    </data></item>\r\n"
      "    <item key=\"Languages\"><list><str>en</str><str>de</str><str/></list></item>\r\n"
      "    <item key=\"Rules\"><list>\r\n  </list></item>\r\n"
      "    <item key=\"Since\"><date>2026-11-22T20:53:00Z</date></item>\r\n"
      "    <item key=\"Escapes &amp;amp;\"><str>&amp;foo; &#x41;&#66; &lt;&gt;&quot;&apos; a&#13;&#10;b</str></item>\r\n"
      "    <item key=\"Nothing\"><null>  </null></item>\r\n"
      "  </map>\r\n"
      "</tenon-document>\r\n";
  const Value expected(Dictionary{
      {"BNBundleIdentifier", "com.example.notes.share"},
      {"BNBundleVersion", "2.4.1"},
      {"XTExtension", Value(Dictionary{{"XTExtensionPointIdentifier", "com.ostrel.share-services"},
                                       {"Summary", "<b>\"text/plain\" & more</b>"},
                                       {"MaxItems", 10},
                                       {"Ratio", 0.75},
                                       {"Beta", false}})},
      {"Icon", Value(Bytes{0xde, 0xad, 0xbe, 0xef})},
      {"Languages", Value(Array{"en", "de", ""})},
      {"Rules", Value(Array{})},
      {"Since", Value(Date{1795380780})},
      {"Escapes &amp;", "&foo; AB <>\"' a\r\nb"},
      {"Nothing", Value()},
  });
  const Value read = readXml(manifest);
  EXPECT_TRUE(Value::identical(read, expected)) << read.description();
  // Dictionaries keep the document's order.
  std::vector<std::string> keys;
  for (const auto& [key, value] : *read.dictionary()) keys.push_back(key);
  EXPECT_EQ(keys, (std::vector<std::string>{"BNBundleIdentifier", "BNBundleVersion", "XTExtension", "Icon",
                                            "Languages", "Rules", "Since", "Escapes &amp;", "Nothing"}));
}

TEST(XmlDocument, KeysAndTextKeepWhatAttributeAndLineEndNormalisationWouldChange) {
  // A reader turns literal tab/LF/CR in attributes into spaces and CR into
  // LF in text; what the writer wrote must come back unchanged regardless.
  const Value v(Dictionary{{"a\tb\nc\rd\r\ne", "x\ry\r\nz"}});
  const std::string written = *writeXmlDocument(v);
  EXPECT_NE(written.find("key=\"a&#9;b&#10;c&#13;d&#13;&#10;e\""), std::string::npos) << written;
  EXPECT_NE(written.find("<str>x&#13;y&#13;\nz</str>"), std::string::npos) << written;
  EXPECT_TRUE(Value::identical(readXml(written), v));
  // The same characters written literally are normalised, as XML requires.
  EXPECT_TRUE(Value::identical(
      readXml("<tenon-document version=\"1\"><map><item key=\"a\tb\nc\"><str>x\ry\r\nz</str></item></map></tenon-document>"),
      Value(Dictionary{{"a b c", "x\ny\nz"}})));
}

}  // namespace
}  // namespace tn
