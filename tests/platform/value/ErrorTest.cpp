#include "platform/value/Error.h"

#include <gtest/gtest.h>

#include "platform/value/Result.h"

namespace tn {
namespace {

TEST(TNMakeError, WithoutMessageHasNoUserInformationAndAGenericDescription) {
  Error e = TNMakeError(9);
  EXPECT_EQ(e.domain(), "Tenon");
  EXPECT_EQ(e.code(), 9);
  EXPECT_FALSE(e.message());
  EXPECT_EQ(e.localizedDescription(), "The operation could not be completed (Tenon error 9)");
  EXPECT_FALSE(TNMakeErrorWithFormat(9, std::nullopt).message());
}

TEST(TNMakeError, FormatSubstitutesEveryArgument) {
  Error e = TNMakeErrorWithFormat(4, "unable to enable plug-in {}({})", "com.example.a", "E621");
  EXPECT_EQ(e.code(), 4);
  EXPECT_EQ(e.message(), "unable to enable plug-in com.example.a(E621)");
  EXPECT_EQ(e.localizedDescription(), *e.message());
  EXPECT_EQ(fmt::format("{}", e), "Tenon 4: unable to enable plug-in com.example.a(E621)");
}

TEST(Result, CarriesEitherTheValueOrTheError) {
  Result<int> good = 3;
  Result<int> bad = TNMakeError(2, std::string("no"));
  ASSERT_TRUE(good);
  EXPECT_EQ(*good, 3);
  ASSERT_FALSE(bad);
  EXPECT_EQ(bad.error().code(), 2);
  Result<void> fine;
  Result<void> failed = TNMakeError(1);
  EXPECT_TRUE(fine);
  EXPECT_FALSE(failed);
}

}  // namespace
}  // namespace tn
