// TNPlugInCore: setup and its failures, derived properties and the
// application-extension defaults, identity, annotations, the diagnosis in
// its order, and the old-style report.

#include "libtenon/model/TNPlugInCore.h"

#include <gtest/gtest.h>

#include "tests/libtenon/model/PlugInTestSupport.h"

namespace tn {
namespace {

using log::Level;

const URL kAppExtension = URL::fileURLWithPath("/opt/App/Support/PlugIns/Share.tnx");
const URL kPlainPlugIn = URL::fileURLWithPath("/opt/App/Support/PlugIns/Share");

Value infoWith(Dictionary plugIn) {
  return Value(Dictionary{{"BNBundleDisplayName", "Share"}, {"XTExtension", Value(std::move(plugIn))}});
}

std::shared_ptr<TNPlugInCore> recordAt(const URL& url, Dictionary plugIn) {
  return TNPlugInCore::create("com.example.share", url, infoWith(std::move(plugIn)), Value(), std::nullopt);
}

std::string diagnosisOf(const TNPlugInCore& record) {
  const std::optional<Error> problem = record.diagnose();
  if (!problem) return "";
  EXPECT_EQ(problem->domain(), "Tenon");
  EXPECT_EQ(problem->code(), 12);
  return problem->localizedDescription();
}

class PlugInCoreTest : public test::ModelTest {};

TEST_F(PlugInCoreTest, SetupStoresTheDictionariesAndLogsAtTheirLevels) {
  const UUID uuid = UUID::random();
  const Dictionary plugIn{{"XTExtensionAttributes", Dictionary{{"XTExtensionVersion", "3"}}}, {"Multiple", true}};
  auto record = TNPlugInCore::create("com.example.share", kAppExtension, infoWith(plugIn), Value(), uuid);
  ASSERT_TRUE(record);
  EXPECT_EQ(record->identifier(), "com.example.share");
  EXPECT_EQ(record->path(), kAppExtension.path());
  EXPECT_EQ(record->uuid(), uuid);
  EXPECT_EQ(record->plugInDictionary(), Value(plugIn));
  EXPECT_EQ(record->version(), Value("3"));
  EXPECT_EQ(record->hubProtocolVersion(), 0u);
  EXPECT_TRUE(logged("ops", Level::Default, "multiplexed plug-ins (Multiple key) obsolete and ignored"));
  EXPECT_TRUE(logged("ops", Level::Debug, "TNPlugInCore::setDictionaries \"Share\""));
  EXPECT_TRUE(logged("rg", Level::Debug, "TNPlugInCore::setupWithName \"Share\""));

  // Without a bundle information dictionary the supplied plug-in dictionary is kept.
  auto separate = TNPlugInCore::create("com.example.old", kPlainPlugIn, Value(), Value(Dictionary{{"a", 1}}), uuid);
  ASSERT_TRUE(separate);
  EXPECT_EQ(separate->plugInDictionary(), Value(Dictionary{{"a", 1}}));
}

TEST_F(PlugInCoreTest, SetupFailsWithoutURLIdentifierOrPlugInDictionary) {
  EXPECT_FALSE(TNPlugInCore::create("x", std::nullopt, Value(), Value(), std::nullopt));
  EXPECT_TRUE(capture_->lines().empty());

  EXPECT_FALSE(TNPlugInCore::create(std::nullopt, kPlainPlugIn, Value(), Value(), std::nullopt));
  EXPECT_TRUE(logged("ops", Level::Error, "missing identifier in plug-in at /opt/App/Support/PlugIns/Share"));

  const Value oldStyle(Dictionary{{"Tenon", Dictionary{}}, {"BNBundleIdentifier", "x"}});
  EXPECT_FALSE(TNPlugInCore::create("x", kPlainPlugIn, oldStyle, Value(), std::nullopt));
  EXPECT_TRUE(logged("ops", Level::Default, "malformed plug-in dictionary in plug-in x at file:///opt/App/Support/PlugIns/Share: {"));

  for (const Value& bad : {Value("text"), Value(Array{}), Value(Dictionary{{"XTExtension", "not a dictionary"}})}) {
    EXPECT_FALSE(TNPlugInCore::create("x", kPlainPlugIn, bad, Value(), std::nullopt)) << bad;
  }
}

TEST_F(PlugInCoreTest, RecordsWithoutUUIDGetFreshOnesAndAreEqualOnlyByUUID) {
  auto first = recordAt(kPlainPlugIn, {});
  auto second = recordAt(kPlainPlugIn, {});
  ASSERT_TRUE(first && second);
  EXPECT_FALSE(*first == *second);

  const UUID shared = UUID::random();
  auto a = TNPlugInCore::create("a", kPlainPlugIn, Value(), Value(), shared);
  auto b = TNPlugInCore::create("b", kAppExtension, Value(), Value(), shared);
  EXPECT_TRUE(*a == *b);
  EXPECT_EQ(a->hash(), b->hash());
  EXPECT_FALSE(a->isEqual(nullptr));
}

TEST_F(PlugInCoreTest, ApplicationExtensionsDefaultProtocolAndPrincipalOnlyUnderTnx) {
  const Dictionary plugIn{{"XTExtensionAttributes", Dictionary{}}};
  auto extension = recordAt(kAppExtension, plugIn);
  EXPECT_TRUE(extension->isAppExtension());
  EXPECT_EQ(extension->protocolSpec(), Value("XTObject"));
  EXPECT_EQ(extension->principalSpec(), Value("XTObject"));
  EXPECT_EQ(extension->embeddedProtocolSpec(), Value("XTObject"));
  EXPECT_EQ(diagnosisOf(*extension), "");

  auto trailingSlash = recordAt(URL::fileURLWithPath("/opt/A/Share.tnx/"), plugIn);
  EXPECT_TRUE(trailingSlash->isAppExtension());

  auto plain = recordAt(kPlainPlugIn, plugIn);
  EXPECT_FALSE(plain->isAppExtension());
  EXPECT_TRUE(plain->protocolSpec().isNull());
  EXPECT_TRUE(plain->principalSpec().isNull());
  EXPECT_EQ(diagnosisOf(*plain), "missing \"XTExtensionProtocol\" key in Info.manifest or SDK");
}

TEST_F(PlugInCoreTest, FlagsFollowTheirKeys) {
  for (const Value& notDedicated : {Value(false), Value(0), Value(0.0), Value("YES")}) {
    EXPECT_FALSE(recordAt(kPlainPlugIn, {{"Dedicated", notDedicated}})->isDedicated()) << notDedicated;
  }
  EXPECT_FALSE(recordAt(kPlainPlugIn, {})->isDedicated());
  EXPECT_TRUE(recordAt(kPlainPlugIn, {{"Dedicated", true}})->isDedicated());
  EXPECT_TRUE(recordAt(kPlainPlugIn, {{"Dedicated", 1}})->isDedicated());

  EXPECT_TRUE(recordAt(kPlainPlugIn, {{"EmbeddedCode", false}})->isHybrid());
  EXPECT_FALSE(recordAt(kPlainPlugIn, {})->isHybrid());

  EXPECT_TRUE(recordAt(kPlainPlugIn, {{"XTExtensionProtocol", "#Data"}})->isData());
  EXPECT_FALSE(recordAt(kPlainPlugIn, {{"XTExtensionProtocol", "#Data2"}})->isData());
  EXPECT_FALSE(recordAt(kAppExtension, {})->isData());

  auto embedded = recordAt(kPlainPlugIn, {{"XTExtensionProtocol", "p"}, {"EmbeddedProtocol", "e"}});
  EXPECT_EQ(embedded->embeddedProtocolSpec(), Value("e"));
  EXPECT_FALSE(embedded->isMultiplexed());
  EXPECT_FALSE(embedded->embeddedCodePath());
  EXPECT_FALSE(embedded->dataContainerURL());

  embedded->setLastModified(86400);
  EXPECT_EQ(embedded->timestamp(), (Date{86400.0}));
}

TEST_F(PlugInCoreTest, DiagnoseReportsTheFirstFailingCheckInOrder) {
  const Dictionary complete{{"XTExtensionProtocol", "com.example.p"}, {"XTExtensionAttributes", Dictionary{}}};
  EXPECT_EQ(diagnosisOf(*recordAt(kPlainPlugIn, complete)), "");

  // Everything wrong at once: each fix uncovers the next check.
  Dictionary plugIn{{"PrincipalClass", "MyClass"}, {"PassProxy", true}, {"EmbeddedCode", "x"}};
  auto record = recordAt(kAppExtension, plugIn);
  record->setIdentifier(std::nullopt);
  EXPECT_EQ(diagnosisOf(*record), "missing identifier (no XTExtensionIdentifier, nor even BNBundleIdentifier)");
  record->setIdentifier("x");
  EXPECT_EQ(diagnosisOf(*record), "missing \"XTExtensionAttributes\" key in Info.manifest or SDK");
  plugIn.set("XTExtensionAttributes", "not a dictionary");
  record->setPlugInDictionary(Value(plugIn));
  EXPECT_EQ(diagnosisOf(*record), "missing \"XTExtensionAttributes\" key in Info.manifest or SDK");
  plugIn.set("XTExtensionAttributes", Dictionary{});
  record->setPlugInDictionary(Value(plugIn));
  EXPECT_EQ(diagnosisOf(*record), "Application Extensions may not use the \"PrincipalClass\" key");
  plugIn.set("PrincipalClass", "XTObject");
  record->setPlugInDictionary(Value(plugIn));
  EXPECT_EQ(diagnosisOf(*record), "the \"PassProxy\" key is not supported on this platform");
  plugIn.erase("PassProxy");
  record->setPlugInDictionary(Value(plugIn));
  EXPECT_EQ(diagnosisOf(*record), "hybrid plug-ins are not supported on this platform");
  plugIn.erase("EmbeddedCode");
  record->setPlugInDictionary(Value(plugIn));
  EXPECT_EQ(diagnosisOf(*record), "");

  // A principal class of the wrong kind is not "XTObject" either.
  plugIn.set("PrincipalClass", 5);
  record->setPlugInDictionary(Value(plugIn));
  EXPECT_EQ(diagnosisOf(*record), "Application Extensions may not use the \"PrincipalClass\" key");
  // The protocol check comes before the attributes check.
  auto plain = recordAt(kPlainPlugIn, {});
  EXPECT_EQ(diagnosisOf(*plain), "missing \"XTExtensionProtocol\" key in Info.manifest or SDK");
}

TEST_F(PlugInCoreTest, LookupsAnswerNoneForMissingKeysAndDictionaries) {
  TNPlugInCore empty;
  EXPECT_TRUE(empty.infoKey("BNBundleName").isNull());
  EXPECT_TRUE(empty.pluginKey("Dedicated").isNull());
  EXPECT_TRUE(empty.attribute("XTExtensionVersion").isNull());
  EXPECT_TRUE(empty.version().isNull());
  EXPECT_FALSE(empty.path());
  EXPECT_FALSE(empty.isAppExtension());
  EXPECT_TRUE(empty.augmentInterface(Value("x")).isNull());

  auto record = recordAt(kPlainPlugIn, {{"XTExtensionAttributes", "flat"}});
  EXPECT_TRUE(record->attribute("XTExtensionVersion").isNull());
  EXPECT_EQ(record->infoKey("BNBundleDisplayName"), Value("Share"));
  EXPECT_TRUE(logged("rg", Level::Debug, "TNPlugInCore::infoKey BNBundleDisplayName => \"Share\""));
}

TEST_F(PlugInCoreTest, OldStyleByTheKeysPresentAndReportsNeither) {
  auto current = recordAt(kPlainPlugIn, {});
  EXPECT_FALSE(current->oldStyle());

  TNPlugInCore old;
  old.setBundleInfoDictionary(Value(Dictionary{{"Tenon", Dictionary{}}}));
  EXPECT_TRUE(old.oldStyle());
  EXPECT_FALSE(logged("ops", Level::Error, "unknown plug-in configuration style"));

  TNPlugInCore neither;
  neither.setBundleInfoDictionary(Value(Dictionary{{"BNBundleName", "x"}}));
  EXPECT_TRUE(neither.oldStyle());
  EXPECT_TRUE(logged("ops", Level::Error, "unknown plug-in configuration style"));
}

TEST_F(PlugInCoreTest, SetAnnotationReplacesTheDictionaryWithoutChangingTheOld) {
  auto record = recordAt(kPlainPlugIn, {});
  record->setAnnotation("election", Value(1));
  EXPECT_EQ(record->annotations(), Value(Dictionary{{"election", 1}}));

  const Value before = record->annotations();
  record->setAnnotation("extension", Value(Dictionary{{"a", 1}}));
  record->setAnnotation("election", std::nullopt);
  EXPECT_EQ(record->annotations(), Value(Dictionary{{"extension", Dictionary{{"a", 1}}}}));
  EXPECT_EQ(before, Value(Dictionary{{"election", 1}}));

  // An annotations value of another kind counts as an empty dictionary.
  record->setAnnotations(Value("junk"));
  record->setAnnotation("election", Value(0));
  EXPECT_EQ(record->annotations(), Value(Dictionary{{"election", 0}}));
}

// A derived record answers the virtual getters; the derived properties and
// the form follow it.
class RegistryBackedRecord : public TNPlugInCore {
 public:
  Value pluginKey(std::string_view key) const override {
    if (key == "XTExtensionProtocol") return Value("from-registry");
    return TNPlugInCore::pluginKey(key);
  }
  std::optional<std::string> localizedName() const override { return "Registry Name"; }
};

TEST_F(PlugInCoreTest, DerivedRecordsOverrideTheGetters) {
  auto record = std::make_shared<RegistryBackedRecord>();
  ASSERT_TRUE(record->setupWithName("x", kPlainPlugIn, infoWith({}), Value(), std::nullopt));
  std::shared_ptr<TNPlugInCore> asCore = record;
  EXPECT_EQ(asCore->protocolSpec(), Value("from-registry"));
  record->setOriginalIdentifier("x");
  const Result<Dictionary> form = asCore->exportForm();
  ASSERT_TRUE(form);
  EXPECT_EQ(form->get("localizedDisplayName"), Value("Registry Name"));
}

}  // namespace
}  // namespace tn
