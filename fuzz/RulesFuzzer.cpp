// Fuzzes rules matching: the input is a rules dictionary, decoded as CBOR
// (what a host sends) or, failing that, as a structured-value document (JSON
// or XML, what the host restriction entitlement is written in), each with
// its usual limits. It is matched against a fixed set of daemon plug-in
// records built once from bundles on a private platform root, with the
// system's shared MIME database and made-up elections. Besides not
// crashing, hanging or growing, matching must agree with itself: a plug-in
// that matches the whole rules matches each entry alone.
//
// The input's "rule" and "offer" entries, when present, also go straight to
// the activation-rule evaluator.

#include <stdlib.h>

#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <map>
#include <memory>
#include <span>
#include <string>
#include <vector>

#include "libtenon/registrar/RegistrarLookup.h"
#include "platform/activation/ActivationRule.h"
#include "platform/log/Log.h"
#include "platform/registrar/Registrar.h"
#include "platform/types/TypeSources.h"
#include "platform/value/Cbor.h"
#include "platform/value/Document.h"
#include "tenond/plugin/TNDPlugIn.h"

namespace {

class DiscardSink : public tn::log::Sink {
 public:
  void write(const tn::log::Record&) override {}
};

[[noreturn]] void setupFailed(const std::string& what) {
  std::fprintf(stderr, "rules fuzzer: cannot set up: %s\n", what.c_str());
  std::abort();
}

void writeFile(const std::filesystem::path& path, const std::string& contents) {
  std::filesystem::create_directories(path.parent_path());
  std::ofstream(path) << contents;
}

// An application with one plug-in whose "XTExtension" dictionary holds
// `extra` after the usual keys.
std::string makePlugIn(const std::string& root, const std::string& name, const std::string& extra,
                       const std::string& protocol = "com.example.protocol") {
  const std::string app = root + "/opt/tenon/applications/" + name;
  writeFile(app + "/Info.manifest", R"({"BNBundleIdentifier": "com.example.app.)" + name + R"("})");
  const std::string plugIn = app + "/Support/PlugIns/" + name + ".bundle";
  writeFile(plugIn + "/Info.manifest", R"({"BNBundleIdentifier": "com.example.)" + name +
                                           R"(", "BNBundleVersion": "1.9", "BNBundleName": ")" + name +
                                           R"(", "XTExtension": {"XTExtensionPointIdentifier": "com.example.point",
      "XTExtensionProtocol": ")" + protocol + "\", " + extra + "}}");
  return plugIn;
}

struct Fixture {
  std::shared_ptr<registrar::Registrar> registrar;
  std::unique_ptr<tn::RegistrarLookup> lookup;
  std::vector<std::shared_ptr<tnd::TNDPlugIn>> plugIns;
  std::map<std::string, tn::Dictionary> annotations;
  tnd::TNDMatchContext context;
};

std::shared_ptr<tnd::TNDPlugIn> build(Fixture& fixture, const std::string& bundle, tn::Value entitlements) {
  const registrar::PlugInPtr record = fixture.registrar->plugInForURL(tn::URL::fileURLWithPath(bundle));
  if (!record) return nullptr;
  registrar::PlugInRecord::Fields fields{record->uuid(), record->bundlePath(), record->containingApp(),
                                         record->bundleIdentifier(), record->identifier(), record->bundleVersion(),
                                         record->plugInDictionary(), record->infoDictionary(),
                                         record->registrationDate(), record->onSystemPartition(),
                                         record->localizedName(), record->localizedShortName(),
                                         std::move(entitlements), record->dataContainerPath(),
                                         record->registeredByURL()};
  return tnd::TNDPlugIn::initWithRGData(std::make_shared<registrar::PlugInRecord>(std::move(fields)),
                                        fixture.registrar, *fixture.lookup);
}

Fixture* makeFixture() {
  auto* fixture = new Fixture();
  std::string pattern = (std::filesystem::temp_directory_path() / "tenon-rules-fuzz-XXXXXX").string();
  if (!::mkdtemp(pattern.data())) setupFailed("no temporary directory");
  ::setenv("TENON_ROOT", pattern.c_str(), 1);
  static const std::string root = pattern;
  std::atexit([] {
    std::error_code ignored;
    std::filesystem::remove_all(root, ignored);
  });
  const std::string viewer = makePlugIn(pattern, "viewer", R"("XTExtensionAttributes": {
      "Kind": "viewer", "SupportedTypes": ["image/svg+xml", "text/plain", 7], "XTExtensionVersion": "1.10",
      "XTExtensionActivationRule": {"accepts": {"image/*": 3, "text/uri-list": 1}}})");
  const std::string share = makePlugIn(pattern, "share", R"("XTExtensionAttributes": {
      "Flag": 1, "Off": false, "Zero": 0, "Real": 2.5,
      "XTExtensionActivationRule": {"any": [{"count": {"type": "text/plain", "max": 2}}, {"not": {"only": ["image/png"]}}]}})");
  const std::string data = makePlugIn(pattern, "data", R"("XTExtensionAttributes": {"Kind": "data"})", "#Data");
  const std::string loose = pattern + "/System/Library/Loose.bundle";
  writeFile(loose + "/Info.manifest", R"({"BNBundleIdentifier": "com.example.loose", "XTExtension": {
      "XTExtensionPointIdentifier": "com.example.point", "XTExtensionProtocol": "com.example.protocol",
      "XTExtensionAttributes": {"Kind": "loose"}}})");

  registrar::Registrar::Options options;
  options.watch = false;
  options.locale = "";
  auto opened = registrar::Registrar::open(registrar::RegistrarPaths::forRoot(pattern), options);
  if (!opened.ok()) setupFailed(opened.error().description());
  fixture->registrar = *opened;
  if (auto registered = fixture->registrar->registerPlugIn(tn::URL::fileURLWithPath(loose)); !registered.ok()) {
    setupFailed(registered.error().description());
  }
  fixture->lookup = std::make_unique<tn::RegistrarLookup>(fixture->registrar);
  const tn::Value entitlements(tn::Dictionary{{"com.example.ent", tn::Value(true)}, {"com.example.off", tn::Value(0)},
                                              {tnd::TNDPlugIn::kReplacePlugInEntitlement, tn::Value("com.example.old")}});
  for (const std::string& bundle : {viewer, share, data, loose}) {
    if (auto plugIn = build(*fixture, bundle, bundle == share ? entitlements : tn::Value(tn::Dictionary{}))) {
      fixture->plugIns.push_back(std::move(plugIn));
    }
  }
  if (fixture->plugIns.size() != 4) setupFailed(std::to_string(fixture->plugIns.size()) + " plug-ins of 4 were built");
  fixture->annotations["com.example.viewer"] = tn::Dictionary{{"election", tn::Value(1)}};
  fixture->annotations["com.example.old"] = tn::Dictionary{{"election", tn::Value(-1)}};
  fixture->context.types = types::loadTypeTable(types::TypePaths::forRoot("", "/usr/share"));
  fixture->context.annotationForPlugIn = [fixture](const tnd::TNDPlugIn& plugIn) -> std::optional<tn::Dictionary> {
    auto found = fixture->annotations.find(plugIn.annotationKey());
    if (found == fixture->annotations.end()) return std::nullopt;
    return found->second;
  };
  return fixture;
}

Fixture& fixture() {
  static Fixture* const made = makeFixture();
  return *made;
}

tn::Value decode(const uint8_t* data, size_t size) {
  tn::Result<tn::Value> cbor = tn::decodeCbor(std::span<const uint8_t>(data, size));
  if (cbor.ok()) return *cbor;
  tn::Result<tn::Value> document =
      tn::readDocument(std::string_view(reinterpret_cast<const char*>(data), size), "rules");
  return document.ok() ? *document : tn::Value();
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  (void)fixture();  // what goes wrong setting up is logged on stderr
  tn::log::setSink(std::make_shared<DiscardSink>());
  tn::log::extension().setEnabledLevels(~0u);  // the debug line's formatting is exercised too
  tn::log::ops().setEnabledLevels(~0u);
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  Fixture& f = fixture();
  const tn::Value rules = decode(data, size);
  for (const auto& plugIn : f.plugIns) {
    const bool whole = plugIn->match(rules, f.context);
    const tn::Dictionary* entries = rules.dictionary();
    if (!entries || entries->size() > tnd::TNDPlugIn::kMaxRuleEntries) continue;
    for (const auto& [key, pattern] : *entries) {
      const bool alone = plugIn->matchKey(key, pattern, f.context);
      if (whole && !alone) {
        std::fprintf(stderr, "the whole rules match but the entry %s does not\n%s\n", key.c_str(),
                     rules.description().c_str());
        std::abort();
      }
      if (const std::string* text = pattern.string()) (void)tnd::TNDPlugIn::matchValue(key, std::string_view(*text), f.context);
    }
  }
  (void)activation::evaluate(rules["rule"], rules["offer"], *f.context.types);
  return 0;
}
