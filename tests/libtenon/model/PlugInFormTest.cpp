// Plug-in forms: export with its keys in order and the "bundleInfo"
// rewriting, import with its defaults, the round trip, the export error, and
// canonical attributes.

#include <gtest/gtest.h>

#include "libtenon/model/TNPlugInCore.h"
#include "platform/value/TypedEncoding.h"
#include "tests/libtenon/model/PlugInTestSupport.h"

namespace tn {
namespace {

using log::Level;

const URL kURL = URL::fileURLWithPath("/opt/App/Support/PlugIns/Share.tnx");

Dictionary bundleInfo() {
  return Dictionary{{"BNBundleIdentifier", "com.example.share"},
                    {"BNBundleDisplayName", "Share"},
                    {"BNBundleInfoManifestURL", "file:///opt/App/Support/PlugIns/Share.tnx/Info.manifest"},
                    {"XTExtension", Dictionary{{"XTExtensionPointIdentifier", "com.example.point"},
                                               {"XTExtensionAttributes", Dictionary{{"XTExtensionVersion", "2.0"}}}}}};
}

// A record with every field the form carries.
std::shared_ptr<TNPlugInCore> fullRecord() {
  auto record = TNPlugInCore::create("com.example.share", kURL, Value(bundleInfo()), Value(), UUID::random());
  record->setOriginalIdentifier("com.example.original");
  record->setHubProtocolVersion(2);
  record->setOnSystemVolume(true);
  record->setLastModified(1700000000);
  record->setEntitlements(Value(Dictionary{{"com.example.entitled", true}}));
  record->setContainingUrl(URL::fileURLWithPath("/opt/App"));
  record->setLocalizedName("Teilen");
  record->setLocalizedShortName("Teil");
  record->setLocalizedContainingName("Anwendung");
  record->setLocalizedFileSourceActionNames(Value(Dictionary{{"Open", "Öffnen"}}));
  record->setAnnotation("election", Value(1));
  return record;
}

std::vector<std::string> keysOf(const Dictionary& form) {
  std::vector<std::string> keys;
  for (const auto& [key, value] : form) keys.push_back(key);
  return keys;
}

class PlugInFormTest : public test::ModelTest {};

TEST_F(PlugInFormTest, ExportWritesTheKeysInTheirOrder) {
  const Result<Dictionary> full = fullRecord()->exportForm();
  ASSERT_TRUE(full) << full.error().description();
  EXPECT_EQ(keysOf(*full), (std::vector<std::string>{
                               "hubProtocolVersion", "path", "systemResident", "identifier", "original-identifier",
                               "version", "bundleInfo", "info", "uuid", "lastmodified", "annotations", "entitlements",
                               "containingPath", "localizedContainingDisplayName", "localizedDisplayName",
                               "localizedShortName", "localizedFileSourceActionNames"}));
  EXPECT_TRUE(Value::identical(full->get("hubProtocolVersion"), Value(uint64_t{2})));
  EXPECT_TRUE(Value::identical(full->get("lastmodified"), Value(int64_t{1700000000})));
  EXPECT_TRUE(Value::identical(full->get("systemResident"), Value(true)));
  EXPECT_EQ(full->get("version"), Value("2.0"));
  EXPECT_EQ(full->get("containingPath"), Value("/opt/App"));
  const std::string uuidText = *full->get("uuid").string();
  EXPECT_EQ(uuidText.size(), 36u);
  EXPECT_EQ(uuidText.find_first_of("abcdef"), std::string::npos);

  // The minimal record: no optional key, "<none>" version, empty annotations.
  auto minimal = TNPlugInCore::create("m", URL::fileURLWithPath("/p"), Value(Dictionary{{"XTExtension", Dictionary{}}}),
                                      Value(), std::nullopt);
  minimal->setOriginalIdentifier("m");
  const Result<Dictionary> form = minimal->exportForm();
  ASSERT_TRUE(form);
  EXPECT_EQ(form->size(), 11u);
  EXPECT_EQ(form->get("version"), Value("<none>"));
  EXPECT_EQ(form->get("annotations"), Value(Dictionary{}));
}

TEST_F(PlugInFormTest, BundleInfoDropsTheManifestURLAndCarriesTheLocalizedName) {
  auto record = fullRecord();
  const Result<Dictionary> form = record->exportForm();
  ASSERT_TRUE(form);
  const Value& info = form->get("bundleInfo");
  EXPECT_FALSE(info.dictionary()->contains("BNBundleInfoManifestURL"));
  EXPECT_EQ(info["BNBundleDisplayName"], Value("Teilen"));
  EXPECT_TRUE(logged("rg", Level::Debug, "TNPlugInCore::exportForm BundleInfo[BundleDisplayName] was \"Share\""));
  EXPECT_TRUE(logged("rg", Level::Debug, "TNPlugInCore::exportForm BundleInfo[BundleDisplayName] is \"Teilen\""));
  // The record itself keeps its manifest's values.
  EXPECT_EQ(record->bundleInfoDictionary()["BNBundleDisplayName"], Value("Share"));
  EXPECT_TRUE(record->bundleInfoDictionary().dictionary()->contains("BNBundleInfoManifestURL"));

  record->setLocalizedName(std::nullopt);
  const Result<Dictionary> unlocalized = record->exportForm();
  EXPECT_EQ(unlocalized->get("bundleInfo")["BNBundleDisplayName"], Value("Share"));
  EXPECT_FALSE(unlocalized->get("bundleInfo").dictionary()->contains("BNBundleInfoManifestURL"));
}

TEST_F(PlugInFormTest, ExportThenImportGivesAnEqualRecordWithTheSameFields) {
  auto original = fullRecord();
  const Result<Dictionary> form = original->exportForm();
  ASSERT_TRUE(form);
  // Through the typed encoding, as a client receives it.
  const Result<Value> received = decodeTyped(encodeTyped(Value(*form)));
  ASSERT_TRUE(received);
  auto imported = TNPlugInCore::createWithForm(*received);
  ASSERT_TRUE(imported);
  EXPECT_TRUE(*imported == *original);
  EXPECT_EQ(imported->identifier(), original->identifier());
  EXPECT_EQ(imported->path(), original->path());
  EXPECT_EQ(imported->containingPath(), original->containingPath());
  EXPECT_EQ(imported->originalIdentifier(), original->originalIdentifier());
  EXPECT_EQ(imported->hubProtocolVersion(), 2u);
  EXPECT_EQ(imported->lastModified(), 1700000000);
  EXPECT_TRUE(imported->onSystemVolume());
  EXPECT_EQ(imported->entitlements(), original->entitlements());
  EXPECT_EQ(imported->annotations(), original->annotations());
  EXPECT_EQ(imported->localizedName(), "Teilen");
  EXPECT_EQ(imported->localizedShortName(), "Teil");
  EXPECT_EQ(imported->localizedContainingName(), "Anwendung");
  EXPECT_EQ(imported->localizedFileSourceActionNames(), original->localizedFileSourceActionNames());
  // The plug-in dictionary comes from "bundleInfo", not from "info".
  EXPECT_EQ(imported->plugInDictionary(), original->bundleInfoDictionary()["XTExtension"]);

  // A second export of the import is the same form.
  const Result<Dictionary> again = imported->exportForm();
  ASSERT_TRUE(again);
  EXPECT_EQ(Value(*again), Value(*form));
}

TEST_F(PlugInFormTest, ImportDefaultsAndFailures) {
  const Dictionary minimal{{"path", "/p/X.tnx"}, {"identifier", "x"}};
  auto record = TNPlugInCore::createWithForm(Value(minimal));
  ASSERT_TRUE(record);
  EXPECT_EQ(record->hubProtocolVersion(), 1u);
  EXPECT_EQ(record->lastModified(), 0);
  EXPECT_FALSE(record->onSystemVolume());
  EXPECT_TRUE(record->uuid());
  EXPECT_TRUE(record->plugInDictionary().isNull());
  EXPECT_FALSE(record->containingUrl());

  Dictionary withBadUUID = minimal;
  withBadUUID.set("uuid", "not-a-uuid");
  auto a = TNPlugInCore::createWithForm(Value(withBadUUID));
  auto b = TNPlugInCore::createWithForm(Value(withBadUUID));
  ASSERT_TRUE(a && b);
  EXPECT_FALSE(*a == *b);

  EXPECT_FALSE(TNPlugInCore::createWithForm(Value(Dictionary{{"identifier", "x"}})));
  EXPECT_FALSE(TNPlugInCore::createWithForm(Value(Dictionary{{"path", "/p"}})));
  EXPECT_FALSE(TNPlugInCore::createWithForm(Value(Dictionary{{"path", 5}, {"identifier", "x"}})));
  EXPECT_FALSE(TNPlugInCore::createWithForm(Value("not a form")));
  Dictionary oldStyle = minimal;
  oldStyle.set("bundleInfo", Dictionary{{"Tenon", Dictionary{}}});
  EXPECT_FALSE(TNPlugInCore::createWithForm(Value(oldStyle)));

  // Values of the wrong kind count as absent.
  Dictionary junk = minimal;
  junk.set("hubProtocolVersion", "2");
  junk.set("lastmodified", "yesterday");
  junk.set("annotations", Array{});
  junk.set("entitlements", 7);
  junk.set("localizedDisplayName", 3);
  junk.set("hash", "not data");
  auto tolerant = TNPlugInCore::createWithForm(Value(junk));
  ASSERT_TRUE(tolerant);
  EXPECT_EQ(tolerant->hubProtocolVersion(), 1u);
  EXPECT_EQ(tolerant->lastModified(), 0);
  EXPECT_TRUE(tolerant->annotations().isNull());
  EXPECT_TRUE(tolerant->entitlements().isNull());
  EXPECT_FALSE(tolerant->localizedName());
  EXPECT_FALSE(tolerant->cdhash());

  Dictionary signature = minimal;
  signature.set("hash", Bytes{1, 2, 3});
  signature.set("requirement", "anchor");
  auto signedRecord = TNPlugInCore::createWithForm(Value(signature));
  EXPECT_EQ(signedRecord->cdhash(), (Bytes{1, 2, 3}));
  EXPECT_EQ(signedRecord->requirement(), "anchor");
}

TEST_F(PlugInFormTest, ExportNamesTheFirstMissingField) {
  auto record = TNPlugInCore::createWithForm(Value(Dictionary{{"path", "/p/X"}, {"identifier", "x"}}));
  ASSERT_TRUE(record);
  Result<Dictionary> form = record->exportForm();
  ASSERT_FALSE(form);
  EXPECT_EQ(form.error().code(), 12);
  EXPECT_EQ(form.error().localizedDescription(), "cannot export plug-in /p/X: no original identifier");

  record->setOriginalIdentifier("x");
  EXPECT_EQ(record->exportForm().error().localizedDescription(),
            "cannot export plug-in /p/X: no bundle information dictionary");
  record->setBundleInfoDictionary(Value(Dictionary{}));
  EXPECT_EQ(record->exportForm().error().localizedDescription(), "cannot export plug-in /p/X: no plug-in dictionary");
  record->setPlugInDictionary(Value(Dictionary{}));
  EXPECT_TRUE(record->exportForm());

  TNPlugInCore empty;
  EXPECT_EQ(empty.exportForm().error().localizedDescription(), "cannot export plug-in (unnamed): no identifier");
}

TEST_F(PlugInFormTest, UpdateFromFormReplacesOnlyTheAnnotations) {
  auto record = fullRecord();
  record->updateFromForm(Value(Dictionary{{"annotations", Dictionary{{"election", 0}}}, {"identifier", "other"}}));
  EXPECT_EQ(record->annotations(), Value(Dictionary{{"election", 0}}));
  EXPECT_EQ(record->identifier(), "com.example.share");
  record->updateFromForm(Value(Dictionary{}));
  EXPECT_TRUE(record->annotations().isNull());
}

TEST_F(PlugInFormTest, CanonicalizeGivesEveryRecordAttributesAndAVersion) {
  auto bare = TNPlugInCore::create("x", kURL, Value(Dictionary{{"XTExtension", Dictionary{{"Dedicated", true}}}}),
                                   Value(), std::nullopt);
  bare->canonicalize();
  EXPECT_EQ(bare->attributes(), Value(Dictionary{{"XTExtensionVersion", "1"}}));
  EXPECT_EQ(bare->pluginKey("Dedicated"), Value(true));

  auto versioned = TNPlugInCore::create(
      "x", kURL,
      Value(Dictionary{{"BNBundleShortVersionString", "4.2"}, {"XTExtension", Dictionary{{"XTExtensionAttributes", Dictionary{{"k", "v"}}}}}}),
      Value(), std::nullopt);
  versioned->canonicalize();
  EXPECT_EQ(versioned->attributes(), Value(Dictionary{{"k", "v"}, {"XTExtensionVersion", "4.2"}}));
  versioned->canonicalize();
  EXPECT_EQ(versioned->version(), Value("4.2"));

  TNPlugInCore empty;
  empty.canonicalize();
  EXPECT_EQ(empty.version(), Value("1"));
}

}  // namespace
}  // namespace tn
