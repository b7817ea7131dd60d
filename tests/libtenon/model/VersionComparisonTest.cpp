#include "libtenon/model/VersionComparison.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <string>
#include <vector>

namespace tn {
namespace {

TEST(CompareVersionString, DigitRunsCompareAsNumbers) {
  EXPECT_EQ(compareVersionString("1.10", "1.9"), 1);
  EXPECT_EQ(compareVersionString("1.9", "1.10"), -1);
  EXPECT_EQ(compareVersionString("10", "9"), 1);
  EXPECT_EQ(compareVersionString("3.2.1", "3.2.1"), 0);
  EXPECT_EQ(compareVersionString("1.2", "1.2.1"), -1);
  EXPECT_EQ(compareVersionString("1.2.1", "1.2"), 1);
  // Runs longer than any integer type still compare by value.
  EXPECT_EQ(compareVersionString("1.99999999999999999999999", "1.100000000000000000000000"), -1);
  EXPECT_EQ(compareVersionString("2.007", "2.7"), 0);
  EXPECT_EQ(compareVersionString("", ""), 0);
  EXPECT_EQ(compareVersionString("", "0"), -1);
}

TEST(CompareVersionString, OtherCharactersCompareByValueCaseSensitively) {
  EXPECT_EQ(compareVersionString("1.0a", "1.0b"), -1);
  EXPECT_EQ(compareVersionString("1.0B", "1.0a"), -1);  // 'B' < 'a'
  EXPECT_EQ(compareVersionString("1.0-beta", "1.0.1"), -1);  // '-' < '.'
  EXPECT_EQ(compareVersionString("a", "1"), 1);
}

TEST(CompareVersionString, IsAConsistentOrdering) {
  std::vector<std::string> versions{"1", "1.0", "1.0.1", "1.2", "1.10", "2", "10", "10a", "1.2b3", "1.2b10"};
  for (const auto& a : versions) {
    EXPECT_EQ(compareVersionString(a, a), 0);
    for (const auto& b : versions) {
      EXPECT_EQ(compareVersionString(a, b), -compareVersionString(b, a)) << a << " " << b;
      for (const auto& c : versions) {
        if (compareVersionString(a, b) < 0 && compareVersionString(b, c) < 0) {
          EXPECT_LT(compareVersionString(a, c), 0) << a << " " << b << " " << c;
        }
      }
    }
  }
  std::sort(versions.begin(), versions.end(),
            [](const std::string& a, const std::string& b) { return compareVersionString(a, b) < 0; });
  EXPECT_EQ(versions, (std::vector<std::string>{"1", "1.0", "1.0.1", "1.2", "1.2b3", "1.2b10", "1.10", "2",
                                                 "10", "10a"}));
}

}  // namespace
}  // namespace tn
