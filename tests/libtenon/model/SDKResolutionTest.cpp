// SDK resolution: the merge rules at every depth, "CleanTimeout" and
// "Shared", the plug-in's non-dictionary over an SDK dictionary, and
// resolveSDK's lookups, logs and canonicalisation.

#include <gtest/gtest.h>

#include "libtenon/model/TNPlugInCore.h"
#include "tests/libtenon/model/PlugInTestSupport.h"

namespace tn {
namespace {

using log::Level;

const URL kURL = URL::fileURLWithPath("/opt/App/Support/PlugIns/Share.tnx");

bool sameElements(const Value& shared, std::vector<Value> expected) {
  const Array* elements = shared.array();
  if (!elements || elements->size() != expected.size()) return false;
  for (const Value& element : expected) {
    if (std::find(elements->begin(), elements->end(), element) == elements->end()) return false;
  }
  return true;
}

class SDKResolutionTest : public test::ModelTest {
 protected:
  test::FakeRegistryLookup registry_;
};

TEST_F(SDKResolutionTest, PlugInOverridesSDKExceptCleanTimeoutAtEveryDepth) {
  const Dictionary sdk{
      {"XTExtension", Dictionary{{"XTExtensionAttributes", Dictionary{{"A", 2}, {"B", 3}}},
                                 {"CleanTimeout", 5},
                                 {"Nested", Dictionary{{"Deeper", Dictionary{{"CleanTimeout", 9}, {"x", "sdk"}, {"y", "sdk"}}}}}}},
      {"TopOnlyInSDK", "s"}};
  const Dictionary plugIn{
      {"XTExtension", Dictionary{{"XTExtensionAttributes", Dictionary{{"A", 1}}},
                                 {"CleanTimeout", 30},
                                 {"Nested", Dictionary{{"Deeper", Dictionary{{"CleanTimeout", 1}, {"x", "plug-in"}}}}}}},
      {"OnlyInPlugIn", true}};
  const Dictionary sdkBefore = sdk;
  const Dictionary plugInBefore = plugIn;

  const Dictionary merged = TNPlugInCore::mergeDictionary(sdk, plugIn);
  const Value& extension = merged.get("XTExtension");
  EXPECT_EQ(extension["XTExtensionAttributes"], Value(Dictionary{{"A", 1}, {"B", 3}}));
  EXPECT_EQ(extension["CleanTimeout"], Value(5));
  EXPECT_EQ(extension["Nested"]["Deeper"], Value(Dictionary{{"CleanTimeout", 9}, {"x", "plug-in"}, {"y", "sdk"}}));
  EXPECT_EQ(merged.get("TopOnlyInSDK"), Value("s"));
  EXPECT_EQ(merged.get("OnlyInPlugIn"), Value(true));
  // Neither argument changes.
  EXPECT_EQ(sdk, sdkBefore);
  EXPECT_EQ(plugIn, plugInBefore);

  EXPECT_TRUE(TNPlugInCore::sdkOverridesKey("CleanTimeout"));
  EXPECT_FALSE(TNPlugInCore::sdkOverridesKey("Shared"));
  EXPECT_FALSE(TNPlugInCore::sdkOverridesKey("cleantimeout"));
}

TEST_F(SDKResolutionTest, SharedResourcesAreUnitedAtEveryDepth) {
  const Dictionary sdk{{"Shared", Array{"y", "z"}},
                       {"XTExtension", Dictionary{{"Shared", Array{"b", "c", "c"}}, {"Inner", Dictionary{{"Shared", Array{"q"}}}}}}};
  const Dictionary plugIn{{"Shared", Array{"x", "y"}},
                          {"XTExtension", Dictionary{{"Inner", Dictionary{{"Shared", Array{"p", "p"}}}}}}};
  const Dictionary merged = TNPlugInCore::mergeDictionary(sdk, plugIn);
  EXPECT_TRUE(sameElements(merged.get("Shared"), {"x", "y", "z"})) << merged.get("Shared");
  // Only in the SDK: copied as it is, order and duplicates included.
  EXPECT_TRUE(Value::identical(merged.get("XTExtension")["Shared"], Value(Array{"b", "c", "c"})));
  EXPECT_TRUE(sameElements(merged.get("XTExtension")["Inner"]["Shared"], {"p", "q"}));

  // A single resource counts as a one-element array; none as empty.
  EXPECT_TRUE(sameElements(Value(TNPlugInCore::mergeSharedResources(Value("a"), Value(Array{"b"}))), {"a", "b"}));
  EXPECT_TRUE(sameElements(Value(TNPlugInCore::mergeSharedResources(Value(Array{"a", "a"}), Value())), {"a"}));
}

TEST_F(SDKResolutionTest, ANonDictionaryOfThePlugInOverridesAnSDKDictionary) {
  const Dictionary sdk{{"XTExtension", Dictionary{{"XTExtensionAttributes", Dictionary{{"A", 1}}}}}};
  const Dictionary scalar{{"XTExtension", Dictionary{{"XTExtensionAttributes", "none of yours"}}}};
  EXPECT_EQ(TNPlugInCore::mergeDictionary(sdk, scalar).get("XTExtension")["XTExtensionAttributes"],
            Value("none of yours"));
  const Dictionary notEvenADictionary{{"XTExtension", Array{1}}};
  EXPECT_EQ(TNPlugInCore::mergeDictionary(sdk, notEvenADictionary).get("XTExtension"), Value(Array{1}));
}

TEST_F(SDKResolutionTest, ResolveMergesRederivesAndCanonicalises) {
  registry_.sdks["com.example.point"] = Dictionary{
      {"BNBundleDisplayName", "SDK name"},
      {"XTExtension", Dictionary{{"XTExtensionProtocol", "com.example.protocol"},
                                 {"XTExtensionAttributes", Dictionary{{"A", 2}, {"B", 3}}},
                                 {"CleanTimeout", 5}}}};
  const Dictionary info{{"BNBundleDisplayName", "Share"},
                        {"BNBundleShortVersionString", "7"},
                        {"XTExtension", Dictionary{{"XTExtensionPointIdentifier", "com.example.point"},
                                                   {"XTExtensionAttributes", Dictionary{{"A", 1}}},
                                                   {"CleanTimeout", 60}}}};
  auto record = TNPlugInCore::create("x", kURL, Value(info), Value(), std::nullopt);
  record->resolveSDK(registry_);
  EXPECT_EQ(record->protocolSpec(), Value("com.example.protocol"));
  EXPECT_EQ(record->attributes(), Value(Dictionary{{"A", 1}, {"B", 3}, {"XTExtensionVersion", "7"}}));
  EXPECT_EQ(record->pluginKey("CleanTimeout"), Value(5));
  EXPECT_EQ(record->bundleInfoDictionary()["XTExtension"]["CleanTimeout"], Value(5));
  EXPECT_EQ(record->bundleInfoDictionary()["BNBundleDisplayName"], Value("Share"));
  EXPECT_TRUE(logged("rg", Level::Debug, "TNPlugInCore::resolveSDK \"Share\" merged with SDK"));
  EXPECT_FALSE(record->diagnose());

  // Exported forms carry the merged contents.
  record->setOriginalIdentifier("x");
  const Result<Dictionary> form = record->exportForm();
  ASSERT_TRUE(form);
  EXPECT_EQ(form->get("bundleInfo")["XTExtension"]["XTExtensionAttributes"]["B"], Value(3));
}

TEST_F(SDKResolutionTest, UnregisteredOrAbsentSDKOnlyCanonicalises) {
  const Dictionary info{{"XTExtension", Dictionary{{"XTExtensionPointIdentifier", "com.example.unknown"}}}};
  auto record = TNPlugInCore::create("x", kURL, Value(info), Value(), std::nullopt);
  record->resolveSDK(registry_);
  EXPECT_TRUE(logged("ops", Level::Default, "plug-in sdk \"com.example.unknown\" not registered"));
  EXPECT_EQ(record->attributes(), Value(Dictionary{{"XTExtensionVersion", "1"}}));

  auto withoutSDK = TNPlugInCore::create("x", kURL, Value(Dictionary{{"XTExtension", Dictionary{}}}), Value(), std::nullopt);
  withoutSDK->resolveSDK(registry_);
  EXPECT_EQ(withoutSDK->version(), Value("1"));
}

TEST_F(SDKResolutionTest, BadSDKKeyOrMissingManifestStopsResolution) {
  registry_.sdks["5"] = Dictionary{{"XTExtension", Dictionary{{"A", 1}}}};
  const Dictionary info{{"XTExtension", Dictionary{{"XTExtensionPointIdentifier", 5}}}};
  auto record = TNPlugInCore::create("x", kURL, Value(info), Value(), std::nullopt);
  record->resolveSDK(registry_);
  EXPECT_TRUE(logged("ops", Level::Error, "invalid SDK key:5"));
  EXPECT_TRUE(record->attributes().isNull());  // not canonicalised either

  auto bare = TNPlugInCore::create("x", kURL, Value(), Value(Dictionary{}), std::nullopt);
  bare->resolveSDK(registry_);
  EXPECT_TRUE(logged("ops", Level::Error, "cannot resolve SDK without materialized Info.manifest"));
  EXPECT_EQ(bare->plugInDictionary(), Value(Dictionary{}));
}

TEST_F(SDKResolutionTest, AMergedDictionaryWithoutPlugInDictionaryKeepsThePreviousOne) {
  // A record whose plug-in dictionary was supplied apart from its manifest:
  // the merged manifest has no usable "XTExtension", so the plug-in
  // dictionary stays, and the merged manifest is stored all the same.
  registry_.sdks["p"] = Dictionary{{"XTExtension", "flat"}, {"Extra", 1}};
  TNPlugInCore record;
  record.setUrl(kURL);
  record.setBundleInfoDictionary(Value(Dictionary{{"BNBundleName", "x"}}));
  record.setPlugInDictionary(Value(Dictionary{{"XTExtensionPointIdentifier", "p"}}));
  record.resolveSDK(registry_);
  EXPECT_EQ(record.bundleInfoDictionary(),
            Value(Dictionary{{"BNBundleName", "x"}, {"XTExtension", "flat"}, {"Extra", 1}}));
  EXPECT_EQ(record.sdkSpec(), Value("p"));
  EXPECT_EQ(record.version(), Value("1"));
}

}  // namespace
}  // namespace tn
