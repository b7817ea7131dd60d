// JSON documents: what hand-written JSON reads as, what the reader refuses
// and where, and what the (lossy) JSON writer makes of every kind.

#include <gtest/gtest.h>

#include <cmath>
#include <limits>

#include "platform/value/Document.h"

namespace tn {
namespace {

using Code = DocumentErrorCode;

Result<Value> readJson(std::string_view text, std::string_view name = "plugin.json") {
  return readDocument(text, name, DocumentEncoding::Json);
}

std::string errorOf(std::string_view text) {
  Result<Value> read = readJson(text);
  return read ? "accepted as " + read->description() : read.error().localizedDescription();
}

TEST(JsonDocument, NumbersMapByTheirLiteral) {
  struct Row {
    const char* literal;
    Value expected;
  };
  const Row table[] = {
      {"0", Value(int64_t{0})},
      {"-0", Value(int64_t{0})},  // an integer literal: no sign to keep
      {"42", Value(int64_t{42})},
      {"-42", Value(int64_t{-42})},
      {"9223372036854775807", Value(std::numeric_limits<int64_t>::max())},
      {"-9223372036854775808", Value(std::numeric_limits<int64_t>::min())},
      {"9223372036854775808", Value(uint64_t{9223372036854775808ULL})},
      {"18446744073709551615", Value(std::numeric_limits<uint64_t>::max())},
      {"18446744073709551616", Value(18446744073709551616.0)},
      {"-9223372036854775809", Value(-9223372036854775809.0)},
      {"1.0", Value(1.0)},
      {"-0.0", Value(-0.0)},
      {"1e2", Value(100.0)},
      {"1E-2", Value(0.01)},
      {"0.1", Value(0.1)},
      {"5e-324", Value(5e-324)},
      {"1e-400", Value(0.0)},
  };
  for (const Row& row : table) {
    Result<Value> read = readJson(row.literal);
    ASSERT_TRUE(read) << row.literal << ": " << read.error().localizedDescription();
    EXPECT_TRUE(Value::identical(*read, row.expected))
        << row.literal << " read as " << Value::kindName(read->kind()) << " " << read->description();
  }
  EXPECT_TRUE(std::signbit(*readJson("-0.0")->real()));
  EXPECT_EQ(errorOf("1e400"), "plugin.json:1: number overflow parsing '1e400'");
  EXPECT_EQ(errorOf("[\n-1e999]"), "plugin.json:2: number overflow parsing '-1e999'");
}

TEST(JsonDocument, ReadsAHandWrittenPlugInManifestInOrder) {
  const std::string manifest = R"({
  "BNBundleIdentifier": "com.example.notes.share",
  "BNBundleVersion": "2.4.1",
  "XTExtension": {
    "XTExtensionPointIdentifier": "com.ostrel.share-services",
    "XTExtensionAttributes": {
      "XTExtensionActivationRule": {"accepts": {"text/plain": 1}},
      "Summary": "shares \"text/plain\" items",
      "MaxItems": 10,
      "Ratio": 0.75,
      "Beta": false,
      "Icon": null
    }
  },
  "Languages": ["en", "de", "fr\u00e9\ud83d\ude00"],
  "Escapes": "tab\there\nnul\u0000/\/"
}
)";
  const Value expected(Dictionary{
      {"BNBundleIdentifier", "com.example.notes.share"},
      {"BNBundleVersion", "2.4.1"},
      {"XTExtension",
       Value(Dictionary{
           {"XTExtensionPointIdentifier", "com.ostrel.share-services"},
           {"XTExtensionAttributes",
            Value(Dictionary{{"XTExtensionActivationRule",
                              Value(Dictionary{{"accepts", Value(Dictionary{{"text/plain", 1}})}})},
                             {"Summary", "shares \"text/plain\" items"},
                             {"MaxItems", 10},
                             {"Ratio", 0.75},
                             {"Beta", false},
                             {"Icon", Value()}})}})},
      {"Languages", Value(Array{"en", "de", "fr\xC3\xA9\xF0\x9F\x98\x80"})},
      {"Escapes", Value(std::string("tab\there\nnul\0//", 15))},
  });
  Result<Value> read = readDocument("\xEF\xBB\xBF" + manifest, "Info.manifest");
  ASSERT_TRUE(read) << read.error().localizedDescription();
  EXPECT_TRUE(Value::identical(*read, expected)) << read->description();
  std::vector<std::string> keys;
  for (const auto& [key, value] : *read->dictionary()) keys.push_back(key);
  EXPECT_EQ(keys, (std::vector<std::string>{"BNBundleIdentifier", "BNBundleVersion", "XTExtension", "Languages",
                                            "Escapes"}));

  // JSON read, written as XML, reads back the same.
  Result<Value> viaXml = readDocument(*writeXmlDocument(*read), "Info.manifest");
  ASSERT_TRUE(viaXml);
  EXPECT_TRUE(Value::identical(*viaXml, *read));
}

TEST(JsonDocument, BadJsonIsRefusedWithTheLineAtFault) {
  // The parser's own wording follows the line; ours for what it does not check.
  EXPECT_EQ(errorOf("{\n  \"a\": 1,\n  \"b\": 2,\n}\n"),
            "plugin.json:4: syntax error while parsing object key - unexpected '}'; expected string literal");
  EXPECT_EQ(errorOf("{\n  \"a\": 1,\n\n  \"a\": 2\n}"), "plugin.json:4: duplicate key \"a\"");
  EXPECT_EQ(errorOf("{\"a\": {\"b\": 1, \"b\": 2}}"), "plugin.json:1: duplicate key \"b\"");
  EXPECT_EQ(errorOf("[\n\"ok\",\n\"\xff\"]"), "plugin.json:3: invalid UTF-8");

  const std::pair<const char*, const char*> refused[] = {
      {"{\"a\":\n", "plugin.json:2: syntax error while parsing value - unexpected end of input"},
      {"", "plugin.json:1: syntax error while parsing value - unexpected end of input"},
      {"[1]\n[2]", "plugin.json:2: syntax error while parsing value - unexpected '['; expected end of input"},
      {"[\n  // note\n1]", "plugin.json:2: syntax error while parsing value - invalid literal"},
      {"[NaN]", "plugin.json:1: syntax error while parsing value - invalid literal"},
      {"[01]", "plugin.json:1: syntax error while parsing array - unexpected number literal"},
      {"[\"\\ud800\"]", "plugin.json:1: syntax error while parsing value - invalid string: surrogate"},
      {"[\"a\tb\"]", "plugin.json:1: syntax error while parsing value - invalid string: control character U+0009"},
  };
  for (const auto& [json, start] : refused) EXPECT_EQ(errorOf(json).rfind(start, 0), 0u) << errorOf(json);

  // A long bad token is not copied whole into the message.
  const std::string longBad = "[\"" + std::string(100000, 'a') + "\\q\"]";
  EXPECT_LT(errorOf(longBad).size(), 300u);
}

TEST(JsonDocument, NestingIsCappedAtTheLimit) {
  const auto nested = [](int depth) { return std::string(static_cast<size_t>(depth), '[') + std::string(static_cast<size_t>(depth), ']'); };
  EXPECT_TRUE(readJson(nested(kMaxDocumentDepth)));
  Result<Value> tooDeep = readJson("{\"a\":\n" + nested(kMaxDocumentDepth) + "}");
  ASSERT_FALSE(tooDeep);
  EXPECT_EQ(tooDeep.error().localizedDescription(), "plugin.json:2: containers nested deeper than 64");
  EXPECT_TRUE(isDocumentError(tooDeep.error(), Code::TooDeep));
  // Far past the limit is refused just as quickly, without recursion.
  EXPECT_FALSE(readJson(std::string(1000000, '[')));
}

TEST(JsonDocument, WriterMapsWhatJsonCannotHoldAsDocumented) {
  const Value v(Dictionary{
      {"int", Value(int64_t{-3})},
      {"uint", Value(std::numeric_limits<uint64_t>::max())},
      {"real", Value(2.0)},
      {"small", Value(1e-7)},
      {"negative zero", Value(-0.0)},
      {"data", Value(Bytes{0xde, 0xad, 0xbe, 0xef})},
      {"date", Value(Date{1795380780})},
      {"uuid", Value(*UUID::parse("e621e1f8-c36c-495a-93fc-0c247a3e6e5f"))},
      {"text", Value(std::string("q\"\\/\n\r\t\b\f\x01\x7f\0\xC3\xA9", 14))},
      {"list", Value(Array{Value(), true, Value(Array{}), Value(Dictionary{})})},
  });
  EXPECT_EQ(*writeJsonDocument(v), R"({
  "int": -3,
  "uint": 18446744073709551615,
  "real": 2.0,
  "small": 1e-07,
  "negative zero": -0.0,
  "data": "3q2+7w==",
  "date": "2026-11-22T20:53:00Z",
  "uuid": "E621E1F8-C36C-495A-93FC-0C247A3E6E5F",
  "text": "q\"\\/\n\r\t\b\f\u0001)"
                                    "\x7f\\u0000\xC3\xA9"
                                    R"(",
  "list": [
    null,
    true,
    [],
    {}
  ]
}
)");
  EXPECT_EQ(*writeJsonDocument(Value("scalar")), "\"scalar\"\n");
}

TEST(JsonDocument, WhatJsonReadsSurvivesJsonWriteAndRead) {
  // Every value the JSON reader makes is written back to the same value:
  // reals stay reals, large unsigned stay unsigned, strings stay exact.
  const std::string source = R"({"a": [0, -1, 9223372036854775807, 18446744073709551615, 1.5, -0.0, 1e300, 3.0,
    "\u0000\u001f\"\\", "\ud83d\ude00", true, false, null, {}, []], "": {"nested": {"x": 1e-300}}})";
  Result<Value> first = readJson(source);
  ASSERT_TRUE(first);
  Result<std::string> written = writeJsonDocument(*first);
  ASSERT_TRUE(written);
  Result<Value> second = readJson(*written);
  ASSERT_TRUE(second) << second.error().localizedDescription();
  EXPECT_TRUE(Value::identical(*first, *second)) << *written;
}

TEST(JsonDocument, WriterRefusesWhatJsonCannotCarryNamingWhere) {
  const auto errorWriting = [](const Value& v) {
    Result<std::string> written = writeJsonDocument(v);
    if (written) return "written as " + *written;
    EXPECT_TRUE(isDocumentError(written.error(), Code::Unrepresentable));
    return written.error().localizedDescription();
  };
  const double inf = std::numeric_limits<double>::infinity();
  EXPECT_EQ(errorWriting(Value(Dictionary{{"a", Value(Array{1, std::numeric_limits<double>::quiet_NaN()})}})),
            "real nan has no JSON form at [\"a\"][1]");
  EXPECT_EQ(errorWriting(Value(-inf)), "real -inf has no JSON form at the top level");
  EXPECT_EQ(errorWriting(Value(Array{"\xff"})), "string that is not valid UTF-8 at [0]");
  EXPECT_EQ(errorWriting(Value(Dictionary{{"\xC3", 1}})), "key that is not valid UTF-8 at [\"\\xc3\"]");
  EXPECT_EQ(errorWriting(Value(Date{1e300})), "date (1e+300 s since 1970) has no ISO 8601 form at the top level");
}

}  // namespace
}  // namespace tn
