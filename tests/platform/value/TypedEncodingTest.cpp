#include "platform/value/TypedEncoding.h"

#include <gtest/gtest.h>

#include <limits>

#include "platform/value/MessageValue.h"
#include "tests/platform/value/CborTestSupport.h"
#include "tests/support/ValueGenerator.h"

namespace tn {
namespace {

using test::bitIdentical;
using test::hexBytes;

TEST(TypedEncodingRoundTrip, GeneratedValuesComeBackIdentical) {
  test::ValueGenerator generator(1337);
  for (int i = 0; i < 3000; ++i) {
    const Value original = generator.any();
    const Value encoded = encodeTyped(original);
    ASSERT_EQ(encoded.kind(), Value::Kind::Data);
    Result<Value> decoded = decodeTyped(encoded);
    ASSERT_TRUE(decoded.ok()) << original.description() << ": " << decoded.error().description();
    ASSERT_TRUE(bitIdentical(*decoded, original))
        << "sent " << original.description() << "\nread " << decoded->description();
  }
}

// How forms travel: as one entry of a reply that goes through the wire's
// CBOR, which must not disturb the kinds inside.
TEST(TypedEncodingRoundTrip, SurvivesTheWireInsideAMessage) {
  test::ValueGenerator generator(2718);
  for (int i = 0; i < 1000; ++i) {
    const Value form = generator.dictionary(4);
    const Value reply(Dictionary{{"version", Value(3)}, {"form", encodeTyped(form)}});
    Result<Value> received = decodeMessageBody(encodeCbor(reply));
    ASSERT_TRUE(received.ok()) << received.error().description();
    const Bytes* bytes = relay_dictionary_get_data(*received, "form");
    ASSERT_NE(bytes, nullptr);
    Result<Value> decoded = decodeTyped(Value(*bytes));
    ASSERT_TRUE(decoded.ok()) << decoded.error().description();
    ASSERT_TRUE(bitIdentical(*decoded, form)) << form.description();
  }
}

TEST(TypedEncodingRoundTrip, KeepsEveryNumberKind) {
  const Dictionary form{
      {"signedZero", Value(int64_t{0})},
      {"signedMax", Value(std::numeric_limits<int64_t>::max())},
      {"signedMin", Value(std::numeric_limits<int64_t>::min())},
      {"unsignedZero", Value(uint64_t{0})},
      {"unsignedMax", Value(std::numeric_limits<uint64_t>::max())},
      {"one", Value(1.0)},
      {"flag", Value(true)},
      {"when", Value(Date{1795902780.25})},
      {"id", Value(*UUID::parse("E621E1F8-C36C-495A-93FC-0C247A3E6E5F"))},
  };
  Result<Value> decoded = decodeTyped(encodeTyped(Value(form)));
  ASSERT_TRUE(decoded.ok());
  EXPECT_TRUE(bitIdentical(*decoded, Value(form)));
  EXPECT_EQ((*decoded)["signedZero"].kind(), Value::Kind::Int);
  EXPECT_EQ((*decoded)["unsignedZero"].kind(), Value::Kind::UInt);
}

TEST(TypedEncodingRoundTrip, AcceptsAnyTopLevelItem) {
  for (const Value& v : {Value("text"), Value(), Value(int64_t{7}), Value(Array{})}) {
    Result<Value> decoded = decodeTyped(encodeTyped(v));
    ASSERT_TRUE(decoded.ok()) << v.description();
    EXPECT_TRUE(Value::identical(*decoded, v));
  }
}

TEST(TypedEncodingErrors, ANonDataValueIsRefused) {
  Result<Value> r = decodeTyped(Value("not data"));
  ASSERT_FALSE(r.ok());
  EXPECT_TRUE(isCborError(r.error(), CborErrorCode::NotTypedData));
  EXPECT_EQ(r.error().message(), "typed encoding must be a data value, found string");
}

TEST(TypedEncodingErrors, TheDecoderStaysStrict) {
  struct Case {
    const char* hex;
    CborErrorCode code;
  };
  const Case cases[] = {
      {"", CborErrorCode::Truncated},
      {"0101", CborErrorCode::TrailingBytes},
      {"c24101", CborErrorCode::UnknownTag},
      {"9f01ff", CborErrorCode::IndefiniteLength},
      {"a2616101616102", CborErrorCode::DuplicateMapKey},
      // The private tag encloses only what it was made for.
      {"da544e594b20", CborErrorCode::InvalidTagContent},
      {"da544e594b6161", CborErrorCode::InvalidTagContent},
      {"da544e594b1b8000000000000000", CborErrorCode::InvalidTagContent},
      {"da544e594bda544e594b01", CborErrorCode::InvalidTagContent},
  };
  for (const Case& c : cases) {
    Result<Value> r = decodeTyped(Value(hexBytes(c.hex)));
    ASSERT_FALSE(r.ok()) << c.hex;
    EXPECT_TRUE(isCborError(r.error(), c.code)) << c.hex << ": " << r.error().description();
  }
  Result<Value> r = decodeTyped(Value(hexBytes("da544e594b6161")));
  EXPECT_EQ(r.error().message(),
            "CBOR error at byte 5: tag 1414420811 (signed integer) must enclose an unsigned integer up to "
            "9223372036854775807");
}

TEST(TypedEncodingErrors, TheDepthLimitAppliesInsideTheBytes) {
  Value deep(int64_t{1});
  for (int i = 0; i <= kMaxCborDepth; ++i) deep = Value(Array{deep});
  Result<Value> r = decodeTyped(encodeTyped(deep));
  ASSERT_FALSE(r.ok());
  EXPECT_TRUE(isCborError(r.error(), CborErrorCode::TooDeep));
}

TEST(TypedEncodingErrors, PlainDecodingRefusesThePrivateTag) {
  // Only a reader that asks for the typed encoding accepts its tag.
  const Value encoded = encodeTyped(Value(Array{Value(int64_t{5})}));
  Result<Value> r = decodeCbor(*encoded.data());
  ASSERT_FALSE(r.ok());
  EXPECT_TRUE(isCborError(r.error(), CborErrorCode::UnknownTag));
}

}  // namespace
}  // namespace tn
