// The CBOR codec against generated values: round trips of every kind, every
// truncation of a valid encoding, and random damage to valid encodings.

#include <gtest/gtest.h>

#include <cmath>
#include <limits>
#include <random>

#include "platform/value/Cbor.h"
#include "tests/platform/value/CborTestSupport.h"
#include "tests/support/ValueGenerator.h"

namespace tn {
namespace {

using test::afterWire;
using test::bitIdentical;

constexpr int kGeneratedValues = 3000;

TEST(CborRoundTrip, GeneratedValuesComeBackExceptThatNonNegativeInt64BecomesUInt64) {
  test::ValueGenerator generator(20261122);
  for (int i = 0; i < kGeneratedValues; ++i) {
    const Value original = generator.any();
    const Bytes encoded = encodeCbor(original);
    Result<Value> decoded = decodeCbor(encoded);
    ASSERT_TRUE(decoded.ok()) << original.description() << ": " << decoded.error().description();
    const Value expected = afterWire(original);
    ASSERT_TRUE(bitIdentical(*decoded, expected))
        << "sent " << original.description() << "\nread " << decoded->description();
    // The encoding is a function of the value: the same bytes again.
    ASSERT_EQ(encodeCbor(*decoded), encoded) << original.description();
  }
}

TEST(CborRoundTrip, GeneratedDictionariesAreValidMessageBodies) {
  test::ValueGenerator generator(7);
  for (int i = 0; i < kGeneratedValues / 3; ++i) {
    const Value original = generator.dictionary(4);
    Result<Value> decoded = decodeMessageBody(encodeCbor(original));
    ASSERT_TRUE(decoded.ok()) << decoded.error().description();
    ASSERT_TRUE(bitIdentical(*decoded, afterWire(original)));
  }
}

TEST(CborRoundTrip, EdgeNumbersKeepTheirValueAndSign) {
  const Value cases[] = {
      Value(uint64_t{1} << 63),
      Value(std::numeric_limits<uint64_t>::max()),
      Value(int64_t{-1}),
      Value(std::numeric_limits<int64_t>::min()),
      Value(std::numeric_limits<int64_t>::max()),
      Value(-0.0),
      Value(std::numeric_limits<double>::quiet_NaN()),
      Value(-std::numeric_limits<double>::quiet_NaN()),
      Value(std::numeric_limits<double>::infinity()),
      Value(-std::numeric_limits<double>::infinity()),
      Value(std::numeric_limits<double>::denorm_min()),
      Value(Date{-0.0}),
      Value(Date{std::numeric_limits<double>::quiet_NaN()}),
      Value(std::string("a\0b", 3)),
      Value(std::string(70000, 'x')),
      Value(Bytes(300, 0xFF)),
  };
  for (const Value& v : cases) {
    Result<Value> decoded = decodeCbor(encodeCbor(v));
    ASSERT_TRUE(decoded.ok()) << v.description();
    EXPECT_TRUE(bitIdentical(*decoded, afterWire(v))) << v.description();
  }
  Result<Value> negativeZero = decodeCbor(encodeCbor(Value(-0.0)));
  ASSERT_TRUE(negativeZero.ok());
  EXPECT_TRUE(std::signbit(*negativeZero->real()));
}

TEST(CborRoundTrip, ContainersNestedExactly64DeepRoundTrip) {
  Value v(uint64_t{1});
  for (int i = 0; i < kMaxCborDepth; ++i)
    v = (i % 2) ? Value(Array{v}) : Value(Dictionary{{"k", v}});
  Result<Value> decoded = decodeCbor(encodeCbor(v));
  ASSERT_TRUE(decoded.ok()) << decoded.error().description();
  EXPECT_TRUE(Value::identical(*decoded, v));
  Result<Value> deeper = decodeCbor(encodeCbor(Value(Array{v})));
  ASSERT_FALSE(deeper.ok());
  EXPECT_TRUE(isCborError(deeper.error(), CborErrorCode::TooDeep));
}

TEST(CborDamage, EveryTruncationOfAValidEncodingFailsAsTruncated) {
  test::ValueGenerator generator(99);
  for (int i = 0; i < 300; ++i) {
    const Bytes encoded = encodeCbor(generator.any(3));
    for (size_t length = 0; length < encoded.size(); ++length) {
      Result<Value> r = decodeCbor(std::span(encoded.data(), length));
      ASSERT_FALSE(r.ok()) << "prefix of " << length << " bytes decoded";
      ASSERT_TRUE(isCborError(r.error(), CborErrorCode::Truncated)) << r.error().description();
    }
  }
}

// Whatever the damage, the decoder answers; and whatever it accepts encodes
// and decodes again to the same value (the fuzzer's check, in small).
TEST(CborDamage, RandomMutationsNeverCrashAndAcceptedInputsAreStable) {
  test::ValueGenerator generator(4242);
  std::mt19937 rng(4242);
  int accepted = 0;
  for (int i = 0; i < 4000; ++i) {
    Bytes bytes = encodeCbor(generator.any(3));
    for (int edits = 1 + static_cast<int>(rng() % 3); edits > 0; --edits) {
      const size_t at = rng() % bytes.size();
      switch (rng() % 4) {
        case 0: bytes[at] = static_cast<uint8_t>(rng()); break;
        case 1: bytes[at] ^= static_cast<uint8_t>(1u << (rng() % 8)); break;
        case 2: bytes.insert(bytes.begin() + static_cast<ptrdiff_t>(at), static_cast<uint8_t>(rng())); break;
        default: if (bytes.size() > 1) bytes.erase(bytes.begin() + static_cast<ptrdiff_t>(at)); break;
      }
    }
    for (CborDialect dialect : {CborDialect::Wire, CborDialect::Typed}) {
      Result<Value> r = decodeCbor(bytes, dialect);
      if (!r.ok()) {
        ASSERT_EQ(r.error().domain(), "CBOR");
        ASSERT_EQ(r.error().message()->rfind("CBOR error at byte ", 0), 0u) << *r.error().message();
        continue;
      }
      ++accepted;
      Result<Value> again = decodeCbor(encodeCbor(*r, dialect), dialect);
      ASSERT_TRUE(again.ok()) << again.error().description();
      ASSERT_TRUE(bitIdentical(*again, *r));
    }
  }
  // Some damage leaves a valid item (a changed digit); make sure that path ran.
  EXPECT_GT(accepted, 100);
}

}  // namespace
}  // namespace tn
