// Base64 as documents use it: the RFC 4648 vectors, whitespace in wrapped
// data, and one accepted form per byte string.

#include <gtest/gtest.h>

#include <random>

#include "platform/value/Base64.h"

namespace tn {
namespace {

TEST(Base64, EncodesAndDecodesTheStandardVectors) {
  const std::pair<std::string, std::string> vectors[] = {
      {"", ""},           {"f", "Zg=="},         {"fo", "Zm8="},        {"foo", "Zm9v"},
      {"foob", "Zm9vYg=="}, {"fooba", "Zm9vYmE="}, {"foobar", "Zm9vYmFy"}, {"\xfb\xff", "+/8="},
  };
  for (const auto& [plain, encoded] : vectors) {
    EXPECT_EQ(encodeBase64(plain), encoded);
    EXPECT_EQ(decodeBase64ToString(encoded), plain) << encoded;
  }
}

TEST(Base64, EveryLengthOfRandomBytesRoundTrips) {
  std::mt19937 rng(7);
  for (size_t length = 0; length < 70; ++length) {
    Bytes bytes(length);
    for (auto& b : bytes) b = static_cast<uint8_t>(rng());
    EXPECT_EQ(decodeBase64(encodeBase64(bytes)), bytes) << length;
  }
}

TEST(Base64, WhitespaceIsIgnoredAnywhere) {
  EXPECT_EQ(decodeBase64ToString(" Zm9v\r\n  YmFy\t"), "foobar");
  EXPECT_EQ(decodeBase64ToString("Zm9vYg=\n="), "foob");
  EXPECT_EQ(decodeBase64ToString(" \n "), "");
}

TEST(Base64, AnythingButTheOneCanonicalFormIsRefused) {
  for (const char* bad : {"Zg", "Zg=", "Zm9", "Z===", "Zg==Zg==", "Zg=a", "Zm9v=", "Zm9v====", "Zh==", "Zm9=",
                          "Zm-v", "Zm_v", "Zm9v\x80", "=", "===="})
    EXPECT_FALSE(decodeBase64(bad)) << bad;
}

}  // namespace
}  // namespace tn
