// The CBOR codec against fixed inputs: the exact bytes other clients rely on,
// every rejection rule with its message and offset, and the float widths.

#include "platform/value/Cbor.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>

#include "tests/platform/value/CborTestSupport.h"
#include "tests/platform/value/LargestAllocation.h"

namespace tn {
namespace {

using test::hexBytes;
using test::toHex;

std::string encodedHex(const Value& v, CborDialect dialect = CborDialect::Wire) {
  return toHex(encodeCbor(v, dialect));
}

Value decodedOrDie(std::string_view hex) {
  Result<Value> r = decodeCbor(hexBytes(hex));
  EXPECT_TRUE(r.ok()) << hex << ": " << (r.ok() ? "" : r.error().description());
  return r.ok() ? *r : Value();
}

// ---- Exact bytes ----

TEST(CborEncoding, IntegersUseTheShortestHead) {
  EXPECT_EQ(encodedHex(Value(uint64_t{0})), "00");
  EXPECT_EQ(encodedHex(Value(uint64_t{23})), "17");
  EXPECT_EQ(encodedHex(Value(uint64_t{24})), "1818");
  EXPECT_EQ(encodedHex(Value(uint64_t{255})), "18ff");
  EXPECT_EQ(encodedHex(Value(uint64_t{256})), "190100");
  EXPECT_EQ(encodedHex(Value(uint64_t{65535})), "19ffff");
  EXPECT_EQ(encodedHex(Value(uint64_t{65536})), "1a00010000");
  EXPECT_EQ(encodedHex(Value(uint64_t{4294967295})), "1affffffff");
  EXPECT_EQ(encodedHex(Value(uint64_t{4294967296})), "1b0000000100000000");
  EXPECT_EQ(encodedHex(Value(std::numeric_limits<uint64_t>::max())), "1bffffffffffffffff");
  // Signed integers: negative ones as major type 1, the others as major type 0.
  EXPECT_EQ(encodedHex(Value(int64_t{0})), "00");
  EXPECT_EQ(encodedHex(Value(int64_t{100})), "1864");
  EXPECT_EQ(encodedHex(Value(int64_t{-1})), "20");
  EXPECT_EQ(encodedHex(Value(int64_t{-24})), "37");
  EXPECT_EQ(encodedHex(Value(int64_t{-25})), "3818");
  EXPECT_EQ(encodedHex(Value(int64_t{-256})), "38ff");
  EXPECT_EQ(encodedHex(Value(int64_t{-257})), "390100");
  EXPECT_EQ(encodedHex(Value(std::numeric_limits<int64_t>::min())), "3b7fffffffffffffff");
}

TEST(CborEncoding, ScalarsStringsAndContainers) {
  EXPECT_EQ(encodedHex(Value(1.5)), "fb3ff8000000000000");
  EXPECT_EQ(encodedHex(Value(-0.0)), "fb8000000000000000");
  EXPECT_EQ(encodedHex(Value(1.0)), "fb3ff0000000000000");  // never shortened
  EXPECT_EQ(encodedHex(Value(false)), "f4");
  EXPECT_EQ(encodedHex(Value(true)), "f5");
  EXPECT_EQ(encodedHex(Value()), "f6");
  EXPECT_EQ(encodedHex(Value("")), "60");
  EXPECT_EQ(encodedHex(Value("a")), "6161");
  EXPECT_EQ(encodedHex(Value("\xC3\xBC")), "62c3bc");
  EXPECT_EQ(encodedHex(Value(Bytes{})), "40");
  EXPECT_EQ(encodedHex(Value(Bytes{0x01})), "4101");
  EXPECT_EQ(encodedHex(Value(Array{})), "80");
  EXPECT_EQ(encodedHex(Value(Array{Value(uint64_t{1}), Value(Array{Value(uint64_t{2})})})), "82018102");
  EXPECT_EQ(encodedHex(Value(Dictionary{})), "a0");
  EXPECT_EQ(encodedHex(Value(Dictionary{{"a", Value(uint64_t{1})}})), "a1616101");
  // Keys in the dictionary's order, not sorted.
  EXPECT_EQ(encodedHex(Value(Dictionary{{"b", Value(1)}, {"a", Value(Array{Value(2), Value(3)})}})),
            "a26162016161820203");
  std::string long24(24, 'x');
  EXPECT_EQ(encodedHex(Value(long24)).substr(0, 4), "7818");
}

TEST(CborEncoding, DatesAndUUIDsAreTagged) {
  EXPECT_EQ(encodedHex(Value(Date{1363896240.5})), "c1fb41d452d9ec200000");
  const UUID uuid = *UUID::parse("E621E1F8-C36C-495A-93FC-0C247A3E6E5F");
  EXPECT_EQ(encodedHex(Value(uuid)), "d82550e621e1f8c36c495a93fc0c247a3e6e5f");
}

TEST(CborEncoding, TypedDialectTagsOnlyNonNegativeSignedIntegers) {
  EXPECT_EQ(encodedHex(Value(int64_t{5}), CborDialect::Typed), "da544e594b05");
  EXPECT_EQ(encodedHex(Value(int64_t{0}), CborDialect::Typed), "da544e594b00");
  EXPECT_EQ(encodedHex(Value(int64_t{-1}), CborDialect::Typed), "20");
  EXPECT_EQ(encodedHex(Value(uint64_t{5}), CborDialect::Typed), "05");
  EXPECT_EQ(encodedHex(Value(true), CborDialect::Typed), "f5");
}

TEST(CborEncoding, AppendsAfterWhatTheBufferHolds) {
  Bytes frame = {0xAA, 0xBB};
  appendCbor(frame, Value(Dictionary{{"a", Value(1)}}));
  appendCbor(frame, Value(uint64_t{0}));
  EXPECT_EQ(toHex(frame), "aabba161610100");
}

TEST(CborEncoding, InvalidUtf8IsRepairedSoThePeerCanReadIt) {
  // A lone continuation byte and a cut sequence each become U+FFFD.
  EXPECT_EQ(encodedHex(Value(std::string("a\x80" "b\xE2\x82"))), "6b61efbfbd62efbfbdefbfbd");
  // Keys that become equal after repair: the first is kept, so no duplicate.
  Dictionary d;
  d.set("\xFF", Value(1));
  d.set("\xFE", Value(2));
  d.set("ok", Value(3));
  Result<Value> back = decodeCbor(encodeCbor(Value(d)));
  ASSERT_TRUE(back.ok()) << back.error().description();
  EXPECT_EQ(back->dictionary()->size(), 2u);
  EXPECT_EQ((*back)["\xEF\xBF\xBD"], Value(1));
}

// ---- Decoding what other encoders may write ----

TEST(CborEncoding, AMapWrittenPieceByPieceIsTheMapsEncoding) {
  // Counts on both sides of each head size, values of every kind, and text
  // that needs repair.
  for (const std::size_t count : {0u, 1u, 23u, 24u, 255u, 256u}) {
    Dictionary dictionary;
    for (std::size_t i = 0; i < count; ++i) {
      const Value value = i % 4 == 0   ? Value(int64_t{5})
                          : i % 4 == 1 ? Value(std::string("caf\xc3"))
                          : i % 4 == 2 ? Value(Dictionary{{"n", Value(-3)}})
                                       : Value(Bytes{1, 2});
      dictionary.set("key" + std::to_string(i), value);
    }
    for (const CborDialect dialect : {CborDialect::Wire, CborDialect::Typed}) {
      Bytes pieces;
      appendCborMapHead(pieces, dictionary.size());
      for (const auto& [key, value] : dictionary) appendCborEntry(pieces, key, value, dialect);
      EXPECT_EQ(toHex(pieces), toHex(encodeCbor(Value(dictionary), dialect))) << count << " entries";
    }
  }
}

TEST(CborDecoding, AcceptsLongerHeadsThanNecessary) {
  EXPECT_TRUE(Value::identical(decodedOrDie("1b0000000000000005"), Value(uint64_t{5})));
  EXPECT_TRUE(Value::identical(decodedOrDie("79000161"), Value("a")));
}

TEST(CborDecoding, NegativeIntegersDownToInt64Min) {
  EXPECT_TRUE(Value::identical(decodedOrDie("3b7fffffffffffffff"), Value(std::numeric_limits<int64_t>::min())));
  EXPECT_TRUE(Value::identical(decodedOrDie("20"), Value(int64_t{-1})));
}

TEST(CborDecoding, HalfPrecisionFloatsConvertExactly) {
  EXPECT_EQ(*decodedOrDie("f93c00").real(), 1.0);
  EXPECT_EQ(*decodedOrDie("f9c400").real(), -4.0);
  EXPECT_EQ(*decodedOrDie("f97bff").real(), 65504.0);
  EXPECT_EQ(*decodedOrDie("f90400").real(), std::ldexp(1.0, -14));       // smallest normal
  EXPECT_EQ(*decodedOrDie("f90001").real(), std::ldexp(1.0, -24));       // smallest subnormal
  EXPECT_EQ(*decodedOrDie("f903ff").real(), std::ldexp(1023.0, -24));    // largest subnormal
  EXPECT_EQ(*decodedOrDie("f97c00").real(), std::numeric_limits<double>::infinity());
  EXPECT_EQ(*decodedOrDie("f9fc00").real(), -std::numeric_limits<double>::infinity());
  const double negativeZero = *decodedOrDie("f98000").real();
  EXPECT_EQ(negativeZero, 0.0);
  EXPECT_TRUE(std::signbit(negativeZero));
  EXPECT_TRUE(std::isnan(*decodedOrDie("f97e00").real()));
  // A NaN keeps its sign and payload.
  EXPECT_EQ(std::bit_cast<uint64_t>(*decodedOrDie("f97c01").real()), 0x7FF0040000000000ULL);
  EXPECT_EQ(std::bit_cast<uint64_t>(*decodedOrDie("f9fe00").real()), 0xFFF8000000000000ULL);
}

TEST(CborDecoding, SinglePrecisionFloatsConvertExactly) {
  EXPECT_EQ(*decodedOrDie("fa47c35000").real(), 100000.0);
  EXPECT_EQ(*decodedOrDie("fa3dcccccd").real(), static_cast<double>(0.1f));
  EXPECT_EQ(*decodedOrDie("fa00000001").real(), std::ldexp(1.0, -149));
  EXPECT_EQ(*decodedOrDie("faff800000").real(), -std::numeric_limits<double>::infinity());
  EXPECT_TRUE(std::isnan(*decodedOrDie("fa7fc00000").real()));
  // A signalling NaN is not quietened on the way.
  EXPECT_EQ(std::bit_cast<uint64_t>(*decodedOrDie("fa7f800001").real()), 0x7FF0000020000000ULL);
}

TEST(CborDecoding, DateTagAcceptsEveryNumberWidth) {
  EXPECT_EQ(*decodedOrDie("c11a514b67b0").date(), Date{1363896240});
  EXPECT_EQ(*decodedOrDie("c139012b").date(), Date{-300});
  EXPECT_EQ(*decodedOrDie("c1f93e00").date(), Date{1.5});
  EXPECT_EQ(*decodedOrDie("c1fa47c35000").date(), Date{100000});
  EXPECT_EQ(*decodedOrDie("c1fb41d452d9ec200000").date(), Date{1363896240.5});
}

TEST(CborDecoding, NestingUpTo64LevelsIsAccepted) {
  std::string arrays(2 * kMaxCborDepth, '8');
  for (size_t i = 1; i < arrays.size(); i += 2) arrays[i] = '1';
  EXPECT_TRUE(decodeCbor(hexBytes(arrays + "00")).ok());
  std::string maps;
  for (int i = 0; i < kMaxCborDepth; ++i) maps += "a16161";
  EXPECT_TRUE(decodeCbor(hexBytes(maps + "00")).ok());
}

// ---- Rejections ----

struct Rejection {
  const char* name;
  const char* hex;
  CborErrorCode code;
  const char* message;  // the whole message, offset included
};

void PrintTo(const Rejection& r, std::ostream* os) { *os << r.name; }

std::string rejectionName(const testing::TestParamInfo<Rejection>& param) { return param.param.name; }

class CborRejection : public testing::TestWithParam<Rejection> {};

TEST_P(CborRejection, FailsWithCodeOffsetAndMessage) {
  const Rejection& r = GetParam();
  Result<Value> result = decodeCbor(hexBytes(r.hex));
  ASSERT_FALSE(result.ok()) << "decoded as " << result->description();
  EXPECT_EQ(result.error().domain(), "CBOR");
  EXPECT_TRUE(isCborError(result.error(), r.code)) << result.error().description();
  EXPECT_EQ(result.error().message(), r.message);
}

std::string repeated(std::string_view piece, int times) {
  std::string out;
  for (int i = 0; i < times; ++i) out += piece;
  return out;
}

const std::string kTooDeepArrays = repeated("81", kMaxCborDepth + 1) + "00";
const std::string kTooDeepMaps = repeated("a16161", kMaxCborDepth) + "a0";

INSTANTIATE_TEST_SUITE_P(
    IndefiniteLengths, CborRejection,
    testing::Values(
        Rejection{"ByteString", "5f4101ff", CborErrorCode::IndefiniteLength,
                  "CBOR error at byte 0: indefinite-length byte string not accepted"},
        Rejection{"TextString", "7f6161ff", CborErrorCode::IndefiniteLength,
                  "CBOR error at byte 0: indefinite-length text string not accepted"},
        Rejection{"NestedArray", "82019f01ff", CborErrorCode::IndefiniteLength,
                  "CBOR error at byte 2: indefinite-length array not accepted"},
        Rejection{"Map", "bf616101ff", CborErrorCode::IndefiniteLength,
                  "CBOR error at byte 0: indefinite-length map not accepted"},
        Rejection{"LoneBreak", "ff", CborErrorCode::IndefiniteLength,
                  "CBOR error at byte 0: break code outside an indefinite-length item"},
        Rejection{"IntegerWithInfo31", "1f", CborErrorCode::Malformed,
                  "CBOR error at byte 0: additional information 31 is not valid for major type 0 (unsigned integer)"},
        Rejection{"TagWithInfo31", "df", CborErrorCode::Malformed,
                  "CBOR error at byte 0: additional information 31 is not valid for major type 6 (tag)"}),
    rejectionName);

INSTANTIATE_TEST_SUITE_P(
    Structure, CborRejection,
    testing::Values(
        Rejection{"ArraysTooDeep", kTooDeepArrays.c_str(), CborErrorCode::TooDeep,
                  "CBOR error at byte 64: nesting deeper than 64 levels"},
        Rejection{"MapsTooDeep", kTooDeepMaps.c_str(), CborErrorCode::TooDeep,
                  "CBOR error at byte 192: nesting deeper than 64 levels"},
        Rejection{"IntegerKey", "a10102", CborErrorCode::InvalidMapKey,
                  "CBOR error at byte 1: map key must be a text string, found an unsigned integer"},
        Rejection{"ByteStringKey", "a1416102", CborErrorCode::InvalidMapKey,
                  "CBOR error at byte 1: map key must be a text string, found a byte string"},
        Rejection{"TrailingByte", "0102", CborErrorCode::TrailingBytes,
                  "CBOR error at byte 1: 1 trailing byte after the item"},
        Rejection{"TrailingBytes", "a00000", CborErrorCode::TrailingBytes,
                  "CBOR error at byte 1: 2 trailing bytes after the item"}),
    rejectionName);

INSTANTIATE_TEST_SUITE_P(
    Tags, CborRejection,
    testing::Values(
        Rejection{"Bignum", "c24101", CborErrorCode::UnknownTag, "CBOR error at byte 0: unknown tag 2"},
        Rejection{"SelfDescribe", "d9d9f700", CborErrorCode::UnknownTag, "CBOR error at byte 0: unknown tag 55799"},
        Rejection{"TypedIntegerOnTheWire", "da544e594b05", CborErrorCode::UnknownTag,
                  "CBOR error at byte 0: unknown tag 1414420811"},
        Rejection{"DateOnText", "8201c16161", CborErrorCode::InvalidTagContent,
                  "CBOR error at byte 3: tag 1 (date) must enclose a number, found a text string"},
        Rejection{"DateOnTag", "c1c100", CborErrorCode::InvalidTagContent,
                  "CBOR error at byte 1: tag 1 (date) must enclose a number, found a tag"},
        Rejection{"DateOnNull", "c1f6", CborErrorCode::InvalidTagContent,
                  "CBOR error at byte 1: tag 1 (date) must enclose a number, found null"},
        Rejection{"UUIDOnText", "d8256161", CborErrorCode::InvalidTagContent,
                  "CBOR error at byte 2: tag 37 (UUID) must enclose a 16-byte byte string, found a text string"},
        Rejection{"UUIDOf15Bytes", "d8254f000102030405060708090a0b0c0d0e", CborErrorCode::InvalidTagContent,
                  "CBOR error at byte 2: tag 37 (UUID) must enclose a 16-byte byte string, found 15 bytes"},
        Rejection{"UUIDOf17Bytes", "d8255100000000000000000000000000000000000000", CborErrorCode::InvalidTagContent,
                  "CBOR error at byte 2: tag 37 (UUID) must enclose a 16-byte byte string, found 17 bytes"}),
    rejectionName);

INSTANTIATE_TEST_SUITE_P(
    Truncation, CborRejection,
    testing::Values(
        Rejection{"Empty", "", CborErrorCode::Truncated, "CBOR error at byte 0: unexpected end of input"},
        Rejection{"InHead", "1901", CborErrorCode::Truncated,
                  "CBOR error at byte 0: unexpected end of input in the head of an item"},
        Rejection{"ElementHeadCut", "821901", CborErrorCode::Truncated,
                  "CBOR error at byte 1: unexpected end of input in the head of an item"},
        Rejection{"ArrayEndsEarly", "8301", CborErrorCode::Truncated,
                  "CBOR error at byte 0: array of 3 items exceeds the 1 bytes remaining"},
        Rejection{"ElementMissing", "826161", CborErrorCode::Truncated,
                  "CBOR error at byte 3: unexpected end of input"},
        Rejection{"TextEndsEarly", "6261", CborErrorCode::Truncated,
                  "CBOR error at byte 0: text string of 2 bytes exceeds the 1 bytes remaining"},
        Rejection{"FourGiBString", "5affffffff", CborErrorCode::Truncated,
                  "CBOR error at byte 0: byte string of 4294967295 bytes exceeds the 0 bytes remaining"},
        Rejection{"HugeArray", "9bffffffffffffffff00", CborErrorCode::Truncated,
                  "CBOR error at byte 0: array of 18446744073709551615 items exceeds the 1 bytes remaining"},
        Rejection{"HugeMap", "ba7fffffff616101", CborErrorCode::Truncated,
                  "CBOR error at byte 0: map of 2147483647 entries exceeds the 3 bytes remaining"}),
    rejectionName);

INSTANTIATE_TEST_SUITE_P(
    Scalars, CborRejection,
    testing::Values(
        Rejection{"Reserved28", "1c", CborErrorCode::Malformed, "CBOR error at byte 0: reserved additional information 28"},
        Rejection{"Reserved29", "5d", CborErrorCode::Malformed, "CBOR error at byte 0: reserved additional information 29"},
        Rejection{"Reserved30", "fe", CborErrorCode::Malformed, "CBOR error at byte 0: reserved additional information 30"},
        Rejection{"Undefined", "f7", CborErrorCode::UnsupportedSimpleValue,
                  "CBOR error at byte 0: unsupported simple value 23 (undefined)"},
        Rejection{"Simple16", "f0", CborErrorCode::UnsupportedSimpleValue, "CBOR error at byte 0: unsupported simple value 16"},
        Rejection{"OneByteSimple", "f8ff", CborErrorCode::UnsupportedSimpleValue,
                  "CBOR error at byte 0: unsupported simple value 255"},
        Rejection{"OneByteSimpleLow", "f814", CborErrorCode::UnsupportedSimpleValue,
                  "CBOR error at byte 0: unsupported simple value 20"},
        Rejection{"BelowInt64Min", "3b8000000000000000", CborErrorCode::IntegerOutOfRange,
                  "CBOR error at byte 0: negative integer -9223372036854775809 is below the 64-bit signed range"},
        Rejection{"MinusTwoTo64", "3bffffffffffffffff", CborErrorCode::IntegerOutOfRange,
                  "CBOR error at byte 0: negative integer -18446744073709551616 is below the 64-bit signed range"},
        Rejection{"DateBelowInt64Min", "c13b8000000000000000", CborErrorCode::IntegerOutOfRange,
                  "CBOR error at byte 1: negative integer -9223372036854775809 is below the 64-bit signed range"}),
    rejectionName);

INSTANTIATE_TEST_SUITE_P(
    Utf8, CborRejection,
    testing::Values(
        Rejection{"OverlongTwoBytes", "62c0af", CborErrorCode::InvalidUTF8,
                  "CBOR error at byte 1: text string is not valid UTF-8"},
        Rejection{"OverlongThreeBytes", "6461e080af", CborErrorCode::InvalidUTF8,
                  "CBOR error at byte 2: text string is not valid UTF-8"},
        Rejection{"OverlongFourBytes", "64f08080af", CborErrorCode::InvalidUTF8,
                  "CBOR error at byte 1: text string is not valid UTF-8"},
        Rejection{"Surrogate", "63eda080", CborErrorCode::InvalidUTF8,
                  "CBOR error at byte 1: text string is not valid UTF-8"},
        Rejection{"AboveU10FFFF", "64f4908080", CborErrorCode::InvalidUTF8,
                  "CBOR error at byte 1: text string is not valid UTF-8"},
        Rejection{"LeadF5", "61f5", CborErrorCode::InvalidUTF8, "CBOR error at byte 1: text string is not valid UTF-8"},
        Rejection{"LoneContinuation", "6a6161616161616161618f", CborErrorCode::InvalidUTF8,
                  "CBOR error at byte 10: text string is not valid UTF-8"},
        Rejection{"CutSequence", "6261e2", CborErrorCode::InvalidUTF8,
                  "CBOR error at byte 2: text string is not valid UTF-8"},
        Rejection{"BadKey", "a162c3280a", CborErrorCode::InvalidUTF8, "CBOR error at byte 2: map key is not valid UTF-8"}),
    rejectionName);

TEST(CborDuplicateKeys, NameTheKeyAndWhereItRepeats) {
  // {"version": 1, "aa": 2, "version": 3}
  const Bytes input = hexBytes("a3 6776657273696f6e 01 626161 02 6776657273696f6e 03");
  Result<Value> r = decodeCbor(input);
  ASSERT_FALSE(r.ok());
  EXPECT_TRUE(isCborError(r.error(), CborErrorCode::DuplicateMapKey));
  EXPECT_EQ(r.error().message(), "CBOR error at byte 14: duplicate map key \"version\"");
}

TEST(CborDuplicateKeys, HostileKeysAreEscapedAndCutInTheMessage) {
  std::string key = "a\"\n" + std::string(100, 'k');
  Bytes input = hexBytes("a2 7867");
  input.insert(input.end(), key.begin(), key.end());
  input.push_back(0x01);
  input.insert(input.end(), {0x78, 0x67});
  input.insert(input.end(), key.begin(), key.end());
  input.push_back(0x02);
  Result<Value> r = decodeCbor(input);
  ASSERT_FALSE(r.ok());
  EXPECT_EQ(r.error().message(),
            "CBOR error at byte 107: duplicate map key \"a\\\"\\x0a" + std::string(61, 'k') + "\"...");
}

TEST(CborDuplicateKeys, AreFoundInLargeMapsToo) {
  // 40 distinct keys, then the first again: past the size where lookups hash.
  Bytes input = {0xB8, 41};
  for (int i = 0; i <= 40; ++i) {
    const std::string key = fmt::format("key{:02}", i % 40);
    input.push_back(static_cast<uint8_t>(0x60 + key.size()));
    input.insert(input.end(), key.begin(), key.end());
    input.push_back(0x00);
  }
  Result<Value> r = decodeCbor(input);
  ASSERT_FALSE(r.ok());
  EXPECT_EQ(r.error().message(), "CBOR error at byte 282: duplicate map key \"key00\"");
}

TEST(CborMessageBody, MustBeAMapCheckedBeforeDecoding) {
  Result<Value> body = decodeMessageBody(hexBytes("a1616101"));
  ASSERT_TRUE(body.ok());
  EXPECT_TRUE(body->isDictionary());

  Result<Value> array = decodeMessageBody(hexBytes("820102"));
  ASSERT_FALSE(array.ok());
  EXPECT_TRUE(isCborError(array.error(), CborErrorCode::NotAMap));
  EXPECT_EQ(array.error().message(), "CBOR error at byte 0: message body must be a map, found an array");

  // Not a map wins over whatever is wrong further on.
  Result<Value> text = decodeMessageBody(hexBytes("62ffff"));
  ASSERT_FALSE(text.ok());
  EXPECT_TRUE(isCborError(text.error(), CborErrorCode::NotAMap));

  Result<Value> empty = decodeMessageBody({});
  ASSERT_FALSE(empty.ok());
  EXPECT_TRUE(isCborError(empty.error(), CborErrorCode::Truncated));

  Result<Value> trailing = decodeMessageBody(hexBytes("a0a0"));
  ASSERT_FALSE(trailing.ok());
  EXPECT_TRUE(isCborError(trailing.error(), CborErrorCode::TrailingBytes));
}

TEST(CborHostileLengths, AreRefusedBeforeAnythingIsAllocatedForThem) {
  for (const char* hex : {"5affffffff", "7b00000001000000006161", "9affffffff01", "bb0000000100000000a0"}) {
    const Bytes input = hexBytes(hex);
    test::resetLargestAllocation();
    Result<Value> r = decodeCbor(input);
    const size_t largest = test::largestAllocation();
    ASSERT_FALSE(r.ok()) << hex;
    EXPECT_TRUE(isCborError(r.error(), CborErrorCode::Truncated)) << hex;
    EXPECT_LT(largest, 4096u) << hex;
  }
}

TEST(CborHostileLengths, ADeclaredCountReservesOnlyABoundedAmount) {
  // 100,000 elements declared and 100,000 bytes present, but the first
  // element is bad: a decoder trusting the count would have reserved room for
  // 100,000 values (2.4 MB) before finding out.
  Bytes input = {0x9A, 0x00, 0x01, 0x86, 0xA0, 0xF7};
  input.resize(input.size() + 99999, 0x00);
  test::resetLargestAllocation();
  Result<Value> r = decodeCbor(input);
  const size_t largest = test::largestAllocation();
  ASSERT_FALSE(r.ok());
  EXPECT_EQ(r.error().message(), "CBOR error at byte 5: unsupported simple value 23 (undefined)");
  EXPECT_LT(largest, 100000u);
}

}  // namespace
}  // namespace tn
