// The daemon's plug-in record over real registrar records: the daemon's two
// diagnosis rules, entitlements and the annotation key, form completion with
// sandbox extensions, and the freshness of the information dictionary.

#include <gtest/gtest.h>

#include <unistd.h>

#include "platform/log/CaptureSink.h"
#include "platform/sandbox/Extensions.h"
#include "platform/value/Cbor.h"
#include "tests/tenond/database/DatabaseTestSupport.h"

namespace tnd::test {
namespace {

using tn::Dictionary;
using tn::Value;

class DaemonPlugIn : public ::testing::Test {
 protected:
  void open() {
    registrar_ = root_.open(registrar::test::quiet());
    ASSERT_TRUE(registrar_);
    lookup_ = std::make_unique<tn::RegistrarLookup>(registrar_);
  }
  registrar::PlugInPtr recordAt(const std::string& bundle) const {
    return registrar_->plugInForURL(tn::URL::fileURLWithPath(bundle));
  }
  std::shared_ptr<TNDPlugIn> build(const registrar::PlugInPtr& record) const {
    return TNDPlugIn::initWithRGData(record, registrar_, *lookup_);
  }
  std::shared_ptr<TNDPlugIn> buildAt(const std::string& bundle) const { return build(recordAt(bundle)); }
  // The record with one field changed, as the registrar could have made it.
  static registrar::PlugInPtr changed(const registrar::PlugInRecord& record,
                                      const std::function<void(registrar::PlugInRecord::Fields&)>& change) {
    registrar::PlugInRecord::Fields fields{record.uuid(), record.bundlePath(), record.containingApp(),
                                           record.bundleIdentifier(), record.identifier(), record.bundleVersion(),
                                           record.plugInDictionary(), record.infoDictionary(),
                                           record.registrationDate(), record.onSystemPartition(),
                                           record.localizedName(), record.localizedShortName(), record.entitlements(),
                                           record.dataContainerPath(), record.registeredByURL()};
    change(fields);
    return std::make_shared<registrar::PlugInRecord>(std::move(fields));
  }

  DatabaseRoot root_;
  std::shared_ptr<registrar::Registrar> registrar_;
  std::unique_ptr<tn::RegistrarLookup> lookup_;
};

TEST_F(DaemonPlugIn, LoosePlugInsMustLieOnTheSystemVolumeAndCodeNeedsADataContainer) {
  const std::string onSystem = root_.path() + "/System/Library/X.bundle";
  const std::string elsewhere = root_.path() + "/SystemX/X.bundle";
  registrar::test::PlatformRoot::writePlugIn(onSystem, "com.example.system", "1");
  registrar::test::PlatformRoot::writePlugIn(elsewhere, "com.example.elsewhere", "1");
  const std::string inApp = root_.makeAppWithPlugIn("Host", "com.example.inapp");
  open();
  ASSERT_TRUE(registrar_->registerPlugIn(tn::URL::fileURLWithPath(onSystem)).ok());
  ASSERT_TRUE(registrar_->registerPlugIn(tn::URL::fileURLWithPath(elsewhere)).ok());

  EXPECT_TRUE(buildAt(onSystem));
  EXPECT_TRUE(buildAt(inApp));
  tn::log::ScopedCaptureSink capture;
  EXPECT_FALSE(buildAt(elsewhere));
  EXPECT_TRUE(capture->contains("ops", tn::log::Level::Info,
                                "ignoring mis-configured plug-in at " + elsewhere +
                                    ": plug-ins outside containing apps must be in /System"));

  const auto withoutContainer = changed(*recordAt(inApp), [](auto& f) { f.dataContainerPath.reset(); });
  EXPECT_FALSE(build(withoutContainer));
  EXPECT_TRUE(capture->contains("ops", tn::log::Level::Info, "this plug-in has no sandbox data container"));
  EXPECT_FALSE(build(changed(*recordAt(inApp), [](auto& f) { f.bundlePath.clear(); })));
}

TEST_F(DaemonPlugIn, EntitlementsAndTheAnnotationKey) {
  const std::string bundle = root_.makeAppWithPlugIn("Ent", "com.example.ent");
  open();
  const auto record = recordAt(bundle);
  auto with = [&](Dictionary entitlements) {
    return build(changed(*record, [&](auto& f) { f.entitlements = Value(std::move(entitlements)); }));
  };
  const auto plugIn = with(Dictionary{{"t", Value(true)}, {"one", Value(1)}, {"s", Value("x")},
                                      {"a", Value(tn::Array{})}, {"f", Value(false)}, {"zero", Value(0)},
                                      {"zeroReal", Value(0.0)}});
  ASSERT_TRUE(plugIn);
  for (const char* held : {"t", "one", "s", "a"}) EXPECT_TRUE(plugIn->hasEntitlement(held)) << held;
  for (const char* notHeld : {"f", "zero", "zeroReal", "absent"}) EXPECT_FALSE(plugIn->hasEntitlement(notHeld)) << notHeld;

  EXPECT_EQ(plugIn->annotationKey(), "com.example.ent");
  EXPECT_EQ(with(Dictionary{{TNDPlugIn::kReplacePlugInEntitlement, Value("com.example.old")}})->annotationKey(),
            "com.example.old");
  EXPECT_EQ(with(Dictionary{{TNDPlugIn::kReplacePlugInEntitlement, Value(tn::Array{Value("x")})}})->annotationKey(),
            "com.example.ent");
  EXPECT_EQ(with(Dictionary{{TNDPlugIn::kReplacePlugInEntitlement, Value(7)}})->annotationKey(), "com.example.ent");
}

TEST_F(DaemonPlugIn, HubProtocolVersionAndPrunedDictionaries) {
  const std::string declared = root_.makeAppWithPlugIn("Hub", "com.example.hub", R"(, "HubProtocolVersion": 3)");
  const std::string plain = root_.makeAppWithPlugIn("Plain", "com.example.plain");
  open();
  EXPECT_EQ(buildAt(declared)->hubProtocolVersion(), 3u);
  EXPECT_EQ(buildAt(plain)->hubProtocolVersion(), 2u);
  EXPECT_EQ(Value(TNDPlugIn::prunedInfoDictionaryFor(Dictionary{{"DTSDKName", Value("x")}, {"BNBundleName", Value("y")},
                                                                 {"DT", Value(1)}, {"XDT", Value(2)}})),
            Value(Dictionary{{"BNBundleName", Value("y")}, {"XDT", Value(2)}}));
}

TEST_F(DaemonPlugIn, FormsGetTokensThatConsumeForTheSharedResourcesAndTheService) {
  const std::string shared = root_.makeAppWithPlugIn("Shares", "com.example.shares",
                                                     R"(, "Shared": ["Resources", "Missing"])");
  tn::test::makeDirectory(shared + "/Resources");
  const std::string app = root_.makeApp(root_.appRoot(), "Ext", "com.example.ext");
  const std::string extension = registrar::test::PlatformRoot::makePlugIn(
      app, "Viewer.tnx", "com.example.viewer", "1",
      R"(, "Shared": "Resources", "XTExtensionAttributes": {"Kind": "v"})");
  const std::string data = root_.makeAppWithPlugIn("Data", "com.example.data", R"(, "Shared": ".")", "#Data");
  open();

  Dictionary augmented;
  buildAt(shared)->augmentForm(augmented);
  const Value form(augmented);
  const Value& extensions = form["extensions"];
  ASSERT_TRUE(extensions.isDictionary()) << form.description();
  EXPECT_EQ(extensions.dictionary()->size(), 1u) << "a missing resource is left out";
  const std::string* token = extensions["Resources"].string();
  ASSERT_TRUE(token);
  auto handle = sandbox::consumeExtension(*token);
  ASSERT_TRUE(handle.ok()) << handle.error().description();
  EXPECT_TRUE(sandbox::holdsFileExtension(shared + "/Resources/file"));
  ASSERT_TRUE(form["service-extension"].string());
  ASSERT_TRUE(sandbox::consumeExtension(*form["service-extension"].string()).ok());
  EXPECT_TRUE(sandbox::holdsServiceExtension("com.example.shares"));

  Dictionary augmentedExtension;
  buildAt(extension)->augmentForm(augmentedExtension);
  const Value extensionForm(augmentedExtension);
  ASSERT_TRUE(extensionForm["extensions"].isDictionary());
  EXPECT_EQ(extensionForm["extensions"].dictionary()->size(), 1u);
  EXPECT_TRUE(extensionForm["extensions"]["."].string()) << "an application extension shares its whole bundle";

  Dictionary dataForm;
  buildAt(data)->augmentForm(dataForm);
  EXPECT_TRUE(Value(dataForm)["extensions"]["."].string());
  EXPECT_FALSE(dataForm.contains("service-extension")) << "data plug-ins have no service";
}

TEST_F(DaemonPlugIn, ResourcesOutsideTheBundleGetNoTokenAndAreLogged) {
  const std::string shared = root_.makeAppWithPlugIn(
      "Sneaky", "com.example.sneaky", R"(, "Shared": ["../", "/etc/passwd", "Root", "Inside", "Shared/../.."])");
  tn::test::makeDirectory(shared + "/Shared");
  ASSERT_EQ(::symlink("/", (shared + "/Root").c_str()), 0);
  ASSERT_EQ(::symlink("Shared", (shared + "/Inside").c_str()), 0);
  open();
  tn::log::ScopedCaptureSink capture;
  Dictionary form;
  buildAt(shared)->augmentForm(form);
  const Value extensions = Value(form)["extensions"];
  ASSERT_TRUE(extensions.isDictionary()) << Value(form).description();
  EXPECT_EQ(extensions.dictionary()->size(), 1u) << extensions.description();
  EXPECT_TRUE(extensions["Inside"].string()) << "a link that stays inside is fine";
  for (const std::string resource : {"../", "/etc/passwd", "Root", "Shared/../.."}) {
    EXPECT_TRUE(capture->contains("ops", tn::log::Level::Info,
                                  "refusing extension for resource " + resource + " of plug-in at " + shared))
        << resource;
  }
}

// The form a lookup answers with, built the plain way: the exported form
// (empty when it fails), the annotation, the sandbox extensions, and what a
// discovery adds (replacement marks).
tn::Bytes plainEncodedForm(const TNDPlugIn& plugIn, const Dictionary& annotations, const Dictionary& extra = {}) {
  tn::Result<Dictionary> exported = plugIn.exportForm();
  Dictionary form = exported.ok() ? *exported : Dictionary();
  form.set("annotations", Value(annotations));
  plugIn.augmentForm(form);
  for (const auto& [key, value] : extra) form.set(key, value);
  return tn::encodeCbor(Value(form), tn::CborDialect::Typed);
}

size_t linesContaining(const tn::log::CaptureSink& capture, const std::string& text) {
  size_t lines = 0;
  for (const auto& line : capture.records()) lines += line.text.find(text) != std::string::npos ? 1 : 0;
  return lines;
}

TEST_F(DaemonPlugIn, TheKeptEncodedFormIsByteForByteThePlainOne) {
  const std::string shared = root_.makeAppWithPlugIn("Shares", "com.example.shares",
                                                     R"(, "Shared": ["Resources", "Missing"])");
  tn::test::makeDirectory(shared + "/Resources");
  const std::string data = root_.makeAppWithPlugIn("Data", "com.example.data", R"(, "Shared": ".")", "#Data");
  const std::string plain = root_.makeAppWithPlugIn("Plain", "com.example.plain");
  open();
  const Dictionary annotations{{"election", Value(int64_t{1})}, {"note", Value("caf\xc3")}};
  const Dictionary marks{{"overriding", Value("com.example.old")}, {"overrider", Value("E621E1F8")}};
  tn::log::ScopedCaptureSink capture;
  for (const std::string& bundle : {shared, data, plain}) {
    const auto plugIn = buildAt(bundle);
    ASSERT_TRUE(plugIn) << bundle;
    for (const Dictionary& annotation : {Dictionary(), annotations}) {
      const Value encoded = plugIn->encodedForm(annotation);
      ASSERT_TRUE(encoded.data()) << bundle;
      EXPECT_EQ(*encoded.data(), plainEncodedForm(*plugIn, annotation)) << bundle;
    }
    EXPECT_EQ(*plugIn->encodedForm(annotations, marks).data(), plainEncodedForm(*plugIn, annotations, marks));
  }
  // A resource without a token is tried again (and logged) on every use:
  // only complete extensions are kept. Six uses above, one more here.
  const auto plugIn = buildAt(shared);
  (void)plugIn->encodedForm({});
  EXPECT_EQ(linesContaining(capture.sink(), "failed to make extension for Missing"), 7u);

  // Another plug-in arrives: new knowledge, the same form.
  root_.makeAppWithPlugIn("Other", "com.example.other");
  ASSERT_TRUE(registrar_->scan().ok());
  EXPECT_EQ(*plugIn->encodedForm({}).data(), plainEncodedForm(*plugIn, {}));

  // The plug-in goes away: no form to export, the annotation and the
  // extensions still travel, and the failure is logged on each use.
  std::filesystem::remove_all(root_.appRoot() + "/Shares");
  ASSERT_TRUE(registrar_->scan().ok());
  registrar_->waitForObservers();
  EXPECT_EQ(*plugIn->encodedForm(annotations).data(), plainEncodedForm(*plugIn, annotations));
  EXPECT_TRUE(capture->contains("ops", tn::log::Level::Error, "failed to export matching plug-in"));
}

TEST_F(DaemonPlugIn, TheInformationDictionaryFollowsTheRegistrarsKnowledge) {
  const std::string bundle = root_.makeAppWithPlugIn("Fresh", "com.example.fresh", R"(, "Mood": "old")");
  open();
  const auto plugIn = buildAt(bundle);
  ASSERT_TRUE(plugIn);
  EXPECT_EQ(plugIn->pluginKey("Mood"), Value("old"));
  EXPECT_EQ(plugIn->rgKnowledgeUUID(), registrar_->knowledgeUUID());

  // Another plug-in arrives: new knowledge, one fetch, the same manifest.
  root_.makeAppWithPlugIn("Other", "com.example.other");
  ASSERT_TRUE(registrar_->scan().ok());
  EXPECT_EQ(plugIn->pluginKey("Mood"), Value("old"));
  EXPECT_EQ(plugIn->rgKnowledgeUUID(), registrar_->knowledgeUUID());

  // The plug-in goes away: the record answers none and says why once.
  std::filesystem::remove_all(root_.appRoot() + "/Fresh");
  ASSERT_TRUE(registrar_->scan().ok());
  registrar_->waitForObservers();
  tn::log::ScopedCaptureSink capture;
  EXPECT_TRUE(plugIn->pluginKey("Mood").isNull());
  EXPECT_TRUE(plugIn->infoKey("BNBundleIdentifier").isNull());
  size_t lines = 0;
  for (const auto& line : capture->records())
    if (line.text.find("could not obtain fresh proxy for") != std::string::npos) ++lines;
  EXPECT_EQ(lines, 1u);
  EXPECT_EQ(plugIn->plugInDictionary()["Mood"], Value("old")) << "the plug-in dictionary stays as built";
}

}  // namespace
}  // namespace tnd::test
