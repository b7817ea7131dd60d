#include "platform/value/UUID.h"

#include <gtest/gtest.h>

#include <set>

namespace tn {
namespace {

TEST(UUID, TextIsCanonicalUpperCaseAndParsesBackInEitherCase) {
  auto u = UUID::parse("e621e1f8-c36c-495a-93fc-0c247a3e6e5f");
  ASSERT_TRUE(u);
  EXPECT_EQ(u->string(), "E621E1F8-C36C-495A-93FC-0C247A3E6E5F");
  EXPECT_EQ(UUID::parse(u->string()), u);
  EXPECT_EQ(fmt::format("{}", *u), u->string());
}

TEST(UUID, ParseRefusesEverythingButTheCanonicalForm) {
  for (const char* bad : {"", "E621E1F8C36C495A93FC0C247A3E6E5F", "{E621E1F8-C36C-495A-93FC-0C247A3E6E5F}",
                          "E621E1F8-C36C-495A-93FC-0C247A3E6E5", "E621E1F8-C36C-495A-93FC-0C247A3E6E5FF",
                          "E621E1F8+C36C-495A-93FC-0C247A3E6E5F", "G621E1F8-C36C-495A-93FC-0C247A3E6E5F",
                          "E621E1F8-C36C-495A-93F-C0C247A3E6E5F"})
    EXPECT_FALSE(UUID::parse(bad)) << bad;
}

TEST(UUID, RandomOnesAreVersion4AndDistinct) {
  std::set<UUID> seen;
  for (int i = 0; i < 1000; ++i) {
    UUID u = UUID::random();
    EXPECT_EQ(u.bytes()[6] >> 4, 4);
    EXPECT_EQ(u.bytes()[8] >> 6, 2);
    EXPECT_FALSE(u.isNil());
    seen.insert(u);
  }
  EXPECT_EQ(seen.size(), 1000u);
  EXPECT_TRUE(UUID().isNil());
}

}  // namespace
}  // namespace tn
