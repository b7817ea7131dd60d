// The locale, its language chain, and the name fallback.

#include <gtest/gtest.h>

#include <cstdlib>

#include "platform/registrar/Locale.h"
#include "tests/platform/bundle/BundleTestSupport.h"

namespace registrar {
namespace {

TEST(Locale, LanguageChainDropsCodesetModifierAndRegion) {
  using Chain = std::vector<std::string>;
  EXPECT_EQ(languageChain("de_DE.UTF-8@euro"), (Chain{"de_DE", "de"}));
  EXPECT_EQ(languageChain("fr"), (Chain{"fr"}));
  EXPECT_EQ(languageChain("C.UTF-8"), Chain{});
  EXPECT_EQ(languageChain("POSIX"), Chain{});
  EXPECT_EQ(languageChain(""), Chain{});
  for (const std::string& language : languageChain("../etc_passwd")) EXPECT_EQ(language.find('/'), std::string::npos);
}

TEST(Locale, NamesFallBackFromRegionToLanguageToManifestToDirectory) {
  const tn::Value localizations = tn::Dictionary{
      {"de", tn::Dictionary{{"BNBundleDisplayName", "Teilen"}, {"BNBundleName", "Teil"}}},
      {"de_CH", tn::Dictionary{{"BNBundleName", "Teili"}}},
  };
  const tn::Value info = tn::Dictionary{{"BNBundleName", "Share"}};
  LocalizedNames names = localizedNames(localizations, {"de_CH", "de"}, info, "/a/Share.tnx");
  EXPECT_EQ(names.name, "Teilen");
  EXPECT_EQ(names.shortName, "Teili");
  names = localizedNames(localizations, {"en"}, info, "/a/Share.tnx");
  EXPECT_EQ(names.name, "Share");
  EXPECT_EQ(names.shortName, "Share");
  names = localizedNames(localizations, {}, tn::Dictionary(), "/a/Share.tnx");
  EXPECT_EQ(names.name, "Share");
  EXPECT_EQ(names.shortName, "Share");
}

}  // namespace
}  // namespace registrar
