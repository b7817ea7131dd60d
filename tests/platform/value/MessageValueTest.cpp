#include "platform/value/MessageValue.h"

#include <gtest/gtest.h>

#include <limits>

#include "platform/value/Cbor.h"
#include "tests/platform/value/CborTestSupport.h"
#include "tests/support/ValueGenerator.h"

namespace tn {
namespace {

const UUID kUUID = *UUID::parse("E621E1F8-C36C-495A-93FC-0C247A3E6E5F");

Value sampleMessage() {
  return Value(Dictionary{
      {"request", Value("match")},
      {"uuids", Value(Array{})},
      {"names", Value(Array{Value("a"), Value("b")})},
      {"attributes", Value(Dictionary{{"k", Value(1)}})},
      {"blob", Value(Bytes{1, 2, 3})},
      {"count", Value(uint64_t{7})},
      {"signed", Value(int64_t{7})},
      {"minusOne", Value(int64_t{-1})},
      {"huge", Value(std::numeric_limits<uint64_t>::max())},
      {"flag", Value(false)},
      {"one", Value(1)},
      {"plugin", Value(kUUID)},
      {"nothing", Value()},
  });
}

TEST(RelayDictionaryReads, AnswerWhatTheKeyHoldsWithoutCopying) {
  const Value message = sampleMessage();
  const Array* uuids = relay_dictionary_get_array(message, "uuids");
  ASSERT_NE(uuids, nullptr);
  EXPECT_TRUE(uuids->empty());
  EXPECT_EQ(uuids, message["uuids"].array());  // a pointer into the message
  EXPECT_EQ(relay_dictionary_get_array(message, "names")->size(), 2u);
  EXPECT_EQ(relay_dictionary_get_dictionary(message, "attributes"), message["attributes"].dictionary());
  EXPECT_EQ(relay_dictionary_get_string(message, "request"), message["request"].string());
  EXPECT_EQ(*relay_dictionary_get_string(message, "request"), "match");
  EXPECT_EQ(relay_dictionary_get_data(message, "blob"), message["blob"].data());
  EXPECT_EQ(relay_dictionary_get_bool(message, "flag"), false);
  EXPECT_EQ(relay_dictionary_get_uuid(message, "plugin"), kUUID);
}

TEST(RelayDictionaryReads, AnswerNoneForAbsentKeysAndOtherKinds) {
  const Value message = sampleMessage();
  EXPECT_EQ(relay_dictionary_get_array(message, "request"), nullptr);  // a string
  EXPECT_EQ(relay_dictionary_get_array(message, "missing"), nullptr);
  EXPECT_EQ(relay_dictionary_get_array(message, "nothing"), nullptr);  // null
  EXPECT_EQ(relay_dictionary_get_dictionary(message, "names"), nullptr);
  EXPECT_EQ(relay_dictionary_get_string(message, "blob"), nullptr);
  EXPECT_EQ(relay_dictionary_get_data(message, "request"), nullptr);
  EXPECT_FALSE(relay_dictionary_get_bool(message, "one"));  // a number is not a bool
  EXPECT_FALSE(relay_dictionary_get_bool(message, "missing"));
  EXPECT_FALSE(relay_dictionary_get_uuid(message, "request"));  // not even its text form
  EXPECT_FALSE(relay_dictionary_get_uint64(message, "flag"));
  EXPECT_FALSE(relay_dictionary_get_int64(message, "request"));
}

TEST(RelayDictionaryReads, IntegerReadsConvertOnlyWhenTheValueFits) {
  const Value message = sampleMessage();
  EXPECT_EQ(relay_dictionary_get_uint64(message, "count"), 7u);
  EXPECT_EQ(relay_dictionary_get_uint64(message, "signed"), 7u);
  EXPECT_FALSE(relay_dictionary_get_uint64(message, "minusOne"));
  EXPECT_EQ(relay_dictionary_get_int64(message, "count"), 7);
  EXPECT_EQ(relay_dictionary_get_int64(message, "minusOne"), -1);
  EXPECT_FALSE(relay_dictionary_get_int64(message, "huge"));
  EXPECT_EQ(relay_dictionary_get_uint64(message, "huge"), std::numeric_limits<uint64_t>::max());
}

TEST(RelayDictionaryReads, ReadSignedIntegersSentThroughTheWire) {
  // The wire turns 7 into a uint64; a handler asking for an int64 still gets it.
  Result<Value> received = decodeMessageBody(encodeCbor(sampleMessage()));
  ASSERT_TRUE(received.ok());
  EXPECT_EQ((*received)["signed"].kind(), Value::Kind::UInt);
  EXPECT_EQ(relay_dictionary_get_int64(*received, "signed"), 7);
  EXPECT_EQ(relay_dictionary_get_int64(*received, "minusOne"), -1);
  EXPECT_EQ(relay_dictionary_get_uuid(*received, "plugin"), kUUID);
}

TEST(RelayDictionaryReads, ANonDictionaryMessageHasNoKeys) {
  for (const Value& message : {Value(), Value("uuids"), Value(Array{Value("uuids")})}) {
    EXPECT_EQ(relay_dictionary_get_array(message, "uuids"), nullptr);
    EXPECT_EQ(relay_dictionary_get_string(message, "uuids"), nullptr);
    EXPECT_FALSE(relay_dictionary_get_uint64(message, "uuids"));
    EXPECT_FALSE(relay_dictionary_get_bool(message, "uuids"));
  }
}

bool containsNull(const Value& v) {
  if (v.isNull()) return true;
  if (const Array* a = v.array())
    for (const Value& e : *a)
      if (containsNull(e)) return true;
  if (const Dictionary* d = v.dictionary())
    for (const auto& [key, e] : *d)
      if (containsNull(e)) return true;
  return false;
}

TEST(PlainConversions, DropNullElementsAndKeepEverythingElse) {
  const Value memory(Dictionary{
      {"keep", Value(true)},
      {"gone", Value()},
      {"list", Value(Array{Value(), Value(int64_t{1}), Value(), Value(Array{Value()})})},
      {"nested", Value(Dictionary{{"only", Value()}})},
  });
  const Value expected(Dictionary{
      {"keep", Value(true)},
      {"list", Value(Array{Value(int64_t{1}), Value(Array{})})},
      {"nested", Value(Dictionary{})},
  });
  EXPECT_TRUE(test::bitIdentical(convertMemoryToMessage(memory), expected));
  EXPECT_TRUE(test::bitIdentical(convertMessageToMemory(memory), expected));
  EXPECT_TRUE(convertMemoryToMessage(Value()).isNull());
  EXPECT_TRUE(convertMessageToMemory(Value()).isNull());
}

TEST(PlainConversions, KeepEveryOtherKindExactly) {
  test::ValueGenerator generator(5);
  for (int i = 0; i < 1000; ++i) {
    const Value v = generator.any();
    const Value message = convertMemoryToMessage(v);
    ASSERT_FALSE(containsNull(message) && !v.isNull());
    ASSERT_TRUE(test::bitIdentical(convertMessageToMemory(message), message));
    if (!containsNull(v)) {
      ASSERT_TRUE(test::bitIdentical(message, v)) << v.description();
    }
  }
}

TEST(PlainConversions, TheResultIsIndependentOfTheSource) {
  Value source(Dictionary{{"list", Value(Array{Value(1)})}});
  const Value converted = convertMemoryToMessage(source);
  source.editDictionary()->set("list", Value("changed"));
  EXPECT_EQ(converted["list"].array()->size(), 1u);
}

}  // namespace
}  // namespace tn
