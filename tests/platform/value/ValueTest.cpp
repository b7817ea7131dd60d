#include "platform/value/Value.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>

#include "tests/support/ValueGenerator.h"

namespace tn {
namespace {

TEST(ValueKinds, ConstructorsPickTheKindOfTheCppType) {
  EXPECT_EQ(Value().kind(), Value::Kind::Null);
  EXPECT_EQ(Value(true).kind(), Value::Kind::Bool);
  EXPECT_EQ(Value(3).kind(), Value::Kind::Int);
  EXPECT_EQ(Value(int64_t{-3}).kind(), Value::Kind::Int);
  EXPECT_EQ(Value(3u).kind(), Value::Kind::UInt);
  EXPECT_EQ(Value(uint64_t{3}).kind(), Value::Kind::UInt);
  EXPECT_EQ(Value(3.0).kind(), Value::Kind::Double);
  EXPECT_EQ(Value("s").kind(), Value::Kind::String);
  EXPECT_EQ(Value(Bytes{1}).kind(), Value::Kind::Data);
  EXPECT_EQ(Value(Date{1}).kind(), Value::Kind::Date);
  EXPECT_EQ(Value(UUID()).kind(), Value::Kind::UUID);
  EXPECT_EQ(Value(Array{}).kind(), Value::Kind::Array);
  EXPECT_EQ(Value(Dictionary{}).kind(), Value::Kind::Dictionary);
}

TEST(ValueTypedReads, AnswerNoneForOtherKindsAndConvertIntegersOnlyLosslessly) {
  const Value big(std::numeric_limits<uint64_t>::max());
  EXPECT_FALSE(big.int64());
  EXPECT_EQ(big.uint64(), std::numeric_limits<uint64_t>::max());
  EXPECT_EQ(Value(uint64_t{7}).int64(), 7);
  EXPECT_EQ(Value(int64_t{7}).uint64(), 7u);
  EXPECT_FALSE(Value(-1).uint64());
  EXPECT_FALSE(Value(1.0).int64());
  EXPECT_FALSE(Value(true).int64());
  EXPECT_FALSE(Value(1).boolean());
  EXPECT_FALSE(Value("1").real());
  EXPECT_EQ(Value("x").array(), nullptr);
  EXPECT_EQ(Value(Array{}).dictionary(), nullptr);
  EXPECT_EQ(Value(true).numberAsDouble(), 1.0);
  EXPECT_FALSE(Value("x").numberAsDouble());
}

TEST(ValueEquality, NumbersCompareByValueAcrossKindsButIdenticalDemandsTheKind) {
  EXPECT_EQ(Value(1), Value(true));
  EXPECT_EQ(Value(1), Value(1.0));
  EXPECT_EQ(Value(uint64_t{1}), Value(int64_t{1}));
  EXPECT_NE(Value(-1), Value(std::numeric_limits<uint64_t>::max()));
  EXPECT_NE(Value(2), Value(true));
  EXPECT_NE(Value(1), Value(1.5));
  // 2^63 as a double equals the uint64 2^63, not INT64_MIN.
  EXPECT_EQ(Value(9223372036854775808.0), Value(uint64_t{1} << 63));
  EXPECT_NE(Value(-9223372036854775808.0), Value(uint64_t{1} << 63));
  EXPECT_EQ(Value(-9223372036854775808.0), Value(std::numeric_limits<int64_t>::min()));
  EXPECT_NE(Value(1), Value("1"));

  EXPECT_FALSE(Value::identical(Value(1), Value(true)));
  EXPECT_FALSE(Value::identical(Value(1), Value(1u)));
  EXPECT_FALSE(Value::identical(Value(0.0), Value(0)));
  EXPECT_TRUE(Value::identical(Value(std::nan("")), Value(std::nan(""))));
  EXPECT_EQ(Value(-0.0), Value(0.0));
  EXPECT_FALSE(Value::identical(Value(-0.0), Value(0.0)));
}

TEST(ValueEquality, DictionariesCompareRegardlessOfOrderArraysInOrder) {
  Dictionary ab{{"a", 1}, {"b", 2}};
  Dictionary ba{{"b", 2}, {"a", 1}};
  EXPECT_EQ(Value(ab), Value(ba));
  EXPECT_TRUE(Value::identical(Value(ab), Value(ba)));
  EXPECT_NE(Value(Array{1, 2}), Value(Array{2, 1}));
  Dictionary abc = ab;
  abc.set("c", 3);
  EXPECT_NE(Value(ab), Value(abc));
}

TEST(ValueEquality, EveryGeneratedValueIsIdenticalToItsCopy) {
  test::ValueGenerator gen(7);
  for (int i = 0; i < 500; ++i) {
    Value v = gen.any();
    Value copy = v;
    EXPECT_TRUE(Value::identical(v, copy)) << v.description();
    EXPECT_EQ(v, copy) << v.description();
  }
}

TEST(Dictionary, KeepsInsertionOrderAndReplacesInPlace) {
  Dictionary d;
  d.set("z", 1);
  d.set("a", 2);
  d.set("m", 3);
  d.set("a", 4);
  ASSERT_EQ(d.size(), 3u);
  EXPECT_EQ(d.entries()[0].first, "z");
  EXPECT_EQ(d.entries()[1].first, "a");
  EXPECT_EQ(d.entries()[1].second, Value(4));
  EXPECT_FALSE(d.insertNew("z", 9));
  EXPECT_EQ(d.get("z"), Value(1));
  EXPECT_TRUE(d.get("missing").isNull());
}

TEST(Dictionary, LookupsStayCorrectAcrossTheIndexThresholdAndErasures) {
  Dictionary d;
  for (int i = 0; i < 1000; ++i) d.set("key" + std::to_string(i), i);
  for (int i = 0; i < 1000; i += 3) EXPECT_TRUE(d.erase("key" + std::to_string(i)));
  EXPECT_FALSE(d.erase("key0"));
  for (int i = 0; i < 1000; ++i) {
    const Value* v = d.find("key" + std::to_string(i));
    if (i % 3 == 0) {
      EXPECT_EQ(v, nullptr) << i;
    } else {
      ASSERT_NE(v, nullptr) << i;
      EXPECT_EQ(*v, Value(i));
    }
  }
  // Keys are compared byte for byte: no case folding, embedded NULs count.
  Dictionary e;
  e.set(std::string("a\0b", 3), 1);
  e.set("A", 2);
  EXPECT_EQ(e.find("a"), nullptr);
  EXPECT_EQ(e.find("A")->int64(), 2);
  EXPECT_EQ(e.find(std::string_view("a\0b", 3))->int64(), 1);
}

TEST(ValueEditing, CopyOnWriteLeavesOtherHoldersUntouched) {
  Value original(Dictionary{{"a", 1}});
  Value copy = original;
  copy.editDictionary()->set("b", 2);
  EXPECT_EQ(original.dictionary()->size(), 1u);
  EXPECT_EQ(copy.dictionary()->size(), 2u);
  EXPECT_EQ(Value(1).editDictionary(), nullptr);

  Value list(Array{1});
  Value alias = list;
  alias.editArray()->push_back(2);
  EXPECT_EQ(list.array()->size(), 1u);
}

TEST(ValueDescription, IsOneReadableLine) {
  Dictionary d{{"request", "match"}, {"version", 3u}, {"odd key", Array{true, Value()}}};
  d.set("blob", Bytes{0xde, 0xad});
  EXPECT_EQ(Value(d).description(),
            R"({request: "match", version: 3, "odd key": [true, null], blob: <2 bytes: dead>})");
  EXPECT_EQ(Value("a\"b\n").description(), R"("a\"b\n")");
  EXPECT_EQ(Value(Date{0}).description(), "1970-01-01T00:00:00Z");
}

TEST(ValueSubscript, YieldsNullForMissingKeysAndNonDictionaries) {
  Value v(Dictionary{{"a", Dictionary{{"b", 5}}}});
  EXPECT_EQ(v["a"]["b"], Value(5));
  EXPECT_TRUE(v["x"]["b"].isNull());
  EXPECT_TRUE(Value(3)["a"].isNull());
}

}  // namespace
}  // namespace tn
