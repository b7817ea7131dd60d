// Localization: action titles of file-source plug-ins (one strings query,
// duplicates, missing names and strings) and the localized information
// dictionary with its completion called exactly once on every path.

#include <gtest/gtest.h>

#include "libtenon/model/TNPlugInCore.h"
#include "tests/libtenon/model/PlugInTestSupport.h"

namespace tn {
namespace {

using log::Level;

const URL kURL = URL::fileURLWithPath("/opt/App/Support/PlugIns/Files.tnx");

struct Completion {
  int calls = 0;
  std::optional<Dictionary> result;
  std::optional<Error> error;

  TNPlugInCore::LocalizedInfoCompletion callback() {
    return [this](std::optional<Dictionary> r, std::optional<Error> e) {
      ++calls;
      result = std::move(r);
      error = std::move(e);
    };
  }
};

class LocalizationTest : public test::ModelTest {
 protected:
  test::FakeRegistryLookup registry_;
};

TEST_F(LocalizationTest, ActionTitlesComeFromOneQueryAndFallBackToTheirNames) {
  registry_.tables[kURL.path()]["Localizable"] = {{"Open", "Öffnen"}, {"Unused", "x"}};
  const Dictionary plugIn{{"XTExtensionFileSourceActions",
                           Array{Dictionary{{"XTExtensionFileSourceActionName", "Open"}},
                                 Dictionary{{"XTExtensionFileSourceActionName", "Share"}},
                                 Dictionary{{"XTExtensionFileSourceActionName", "Open"}},
                                 Dictionary{{"Other", 1}},
                                 Value("not a dictionary"),
                                 Dictionary{{"XTExtensionFileSourceActionName", 5}}}}};
  const Dictionary titles = localizedFileSourceActionNamesForTNDict(registry_, kURL, Value(plugIn), kURL.path());
  EXPECT_EQ(titles, (Dictionary{{"Open", "Öffnen"}, {"Share", "Share"}}));
  EXPECT_EQ(registry_.stringQueries, 1);
  EXPECT_EQ(registry_.lastKeys, (std::set<std::string, std::less<>>{"Open", "Share"}));
  EXPECT_EQ(capture_->count("rg", Level::Error, "missing XTExtensionFileSourceActionName for plugin /opt/App"), 3u);
}

TEST_F(LocalizationTest, ActionTitlesWithoutTableOrActions) {
  const Dictionary plugIn{{"XTExtensionFileSourceActions", Array{Dictionary{{"XTExtensionFileSourceActionName", "Open"}}}}};
  EXPECT_EQ(localizedFileSourceActionNamesForTNDict(registry_, kURL, Value(plugIn), "p"), (Dictionary{{"Open", "Open"}}));

  registry_.stringQueries = 0;
  EXPECT_TRUE(localizedFileSourceActionNamesForTNDict(registry_, kURL, Value(Dictionary{}), "p").empty());
  EXPECT_TRUE(localizedFileSourceActionNamesForTNDict(registry_, kURL, Value(), "p").empty());
  const Dictionary notAnArray{{"XTExtensionFileSourceActions", "Open"}};
  EXPECT_TRUE(localizedFileSourceActionNamesForTNDict(registry_, kURL, Value(notAnArray), "p").empty());
  EXPECT_EQ(registry_.stringQueries, 0);
}

TEST_F(LocalizationTest, LocalizedInfoPrefersLocalizedNamesAndLeavesOutMissingKeys) {
  const Dictionary info{{"BNBundleDisplayName", "Files"},
                        {"BNBundleName", "Files"},
                        {"BNBundleShortVersionString", "1.0"},
                        {"XTExtension", Dictionary{}}};
  auto record = TNPlugInCore::create("com.example.files", kURL, Value(info), Value(), std::nullopt);
  Completion unlocalized;
  record->localizedInfoDictionaryForKeys({"BNBundleDisplayName", "BNBundleName", "Missing", "BNBundleShortVersionString"},
                                         unlocalized.callback());
  EXPECT_EQ(unlocalized.calls, 1);
  EXPECT_FALSE(unlocalized.error);
  EXPECT_EQ(unlocalized.result,
            (Dictionary{{"BNBundleDisplayName", "Files"}, {"BNBundleName", "Files"}, {"BNBundleShortVersionString", "1.0"}}));

  record->setLocalizedName("Dateien");
  record->setLocalizedShortName("Dat");
  Completion localized;
  record->localizedInfoDictionaryForKeys({"BNBundleDisplayName", "BNBundleName"}, localized.callback());
  EXPECT_EQ(localized.calls, 1);
  EXPECT_EQ(localized.result, (Dictionary{{"BNBundleDisplayName", "Dateien"}, {"BNBundleName", "Dat"}}));
  EXPECT_TRUE(logged("rg", Level::Debug, "localized values {BNBundleDisplayName: \"Dateien\""));
}

TEST_F(LocalizationTest, LocalizedInfoErrorsGoThroughTheCompletionOnce) {
  auto formOnly = TNPlugInCore::createWithForm(Value(Dictionary{{"path", "/p/X"}, {"identifier", "com.example.x"}}));
  Completion unresolved;
  formOnly->localizedInfoDictionaryForKeys({"BNBundleName"}, unresolved.callback());
  EXPECT_EQ(unresolved.calls, 1);
  EXPECT_FALSE(unresolved.result);
  ASSERT_TRUE(unresolved.error);
  EXPECT_EQ(unresolved.error->code(), -1);
  EXPECT_EQ(unresolved.error->localizedDescription(), "Unable to resolve plugin for com.example.x");
  EXPECT_TRUE(logged("rg", Level::Debug, "localized values null"));

  const Dictionary info{{"Identity", UUID::random()}, {"Fine", "ok"}, {"XTExtension", Dictionary{}}};
  auto record = TNPlugInCore::create("com.example.x", kURL, Value(info), Value(), std::nullopt);
  Completion refused;
  record->localizedInfoDictionaryForKeys({"Fine", "Identity"}, refused.callback());
  EXPECT_EQ(refused.calls, 1);
  EXPECT_FALSE(refused.result);
  ASSERT_TRUE(refused.error);
  EXPECT_EQ(refused.error->localizedDescription(),
            "Value of info dictionary key \"Identity\" for plugin com.example.x does not conform to secure coding!");

  Completion empty;
  record->localizedInfoDictionaryForKeys({}, empty.callback());
  EXPECT_EQ(empty.calls, 1);
  EXPECT_EQ(empty.result, Dictionary());
}

}  // namespace
}  // namespace tn
