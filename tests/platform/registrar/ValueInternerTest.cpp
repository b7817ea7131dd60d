// ValueInterner: equal values share one storage, and nothing that tells two
// values apart (types, key order) is lost.

#include <gtest/gtest.h>

#include "platform/registrar/ValueInterner.h"

namespace registrar {
namespace {

tn::Value attributes(tn::Value kind) {
  return tn::Value(tn::Dictionary{{"XTExtensionVersion", "1.0"}, {"Kind", std::move(kind)}});
}

TEST(ValueInterner, EqualValuesShareOneStorageAtEveryDepth) {
  ValueInterner interner;
  const auto manifest = [](const char* identifier) {
    return tn::Value(tn::Dictionary{{"BNBundleIdentifier", identifier},
                                    {"XTExtension", tn::Dictionary{{"XTExtensionAttributes", attributes("thumb")}}}});
  };
  const tn::Value first = interner.intern(manifest("com.example.one"));
  const tn::Value second = interner.intern(manifest("com.example.two"));
  EXPECT_NE(first.dictionary(), second.dictionary()) << "different identifiers";
  EXPECT_EQ(first["XTExtension"].dictionary(), second["XTExtension"].dictionary());
  EXPECT_EQ(first["XTExtension"]["XTExtensionAttributes"]["XTExtensionVersion"].string(),
            interner.intern(tn::Value("1.0")).string());
  const tn::Value array = interner.intern(tn::Value(tn::Array{attributes("thumb"), "1.0"}));
  EXPECT_EQ(array.array()->at(0).dictionary(), first["XTExtension"]["XTExtensionAttributes"].dictionary());
  EXPECT_EQ(interner.intern(tn::Value(tn::Array{attributes("thumb"), "1.0"})).array(), array.array());
}

TEST(ValueInterner, ValuesThatDifferInTypeOrKeyOrderStayApart) {
  ValueInterner interner;
  const tn::Value integer = interner.intern(attributes(tn::Value(1)));
  const tn::Value real = interner.intern(attributes(tn::Value(1.0)));
  EXPECT_NE(integer.dictionary(), real.dictionary());
  EXPECT_TRUE(real["Kind"].isNumber());
  EXPECT_FALSE(tn::Value::identical(integer, real));

  const tn::Value forward = interner.intern(tn::Value(tn::Dictionary{{"a", 1}, {"b", 2}}));
  const tn::Value backward = interner.intern(tn::Value(tn::Dictionary{{"b", 2}, {"a", 1}}));
  EXPECT_EQ(backward.dictionary()->entries().front().first, "b") << "the order a reply encodes is kept";
  EXPECT_EQ(forward.dictionary()->entries().front().first, "a");
  const tn::Value original(tn::Dictionary{{"n", tn::Value(nullptr)}, {"d", tn::Value(tn::Bytes{1, 2})}});
  EXPECT_TRUE(tn::Value::identical(interner.intern(original), original));
}

}  // namespace
}  // namespace registrar
