// The plug-in model's hot paths, with their targets: export plus import of a
// typical form at most 10 µs; SDK resolution against a 30-key SDK dictionary
// at most 20 µs; issuing one file extension at most 5 µs.

#include <benchmark/benchmark.h>

#include <stdlib.h>
#include <unistd.h>

#include <fmt/format.h>

#include <filesystem>

#include "libtenon/model/TNPlugInCore.h"
#include "libtenon/model/TNSandboxExtension.h"

namespace {

tn::Dictionary typicalInfo() {
  return tn::Dictionary{
      {"BNBundleIdentifier", "com.example.mail.share"},
      {"BNBundleDisplayName", "Share"},
      {"BNBundleName", "Share"},
      {"BNBundleShortVersionString", "2.4.1"},
      {"BNBundleExecutable", "share"},
      {"BNBundleInfoManifestURL", "file:///opt/tenon/applications/Mail/Support/PlugIns/Share.tnx/Info.manifest"},
      {"XTExtension",
       tn::Dictionary{{"XTExtensionPointIdentifier", "com.example.share-services"},
                      {"XTExtensionProtocol", "com.example.share-protocol"},
                      {"Shared", tn::Array{"Resources", "Templates"}},
                      {"XTExtensionAttributes", tn::Dictionary{{"XTExtensionVersion", "2.4.1"},
                                                               {"ShareTypes", tn::Array{"image/png", "text/plain"}},
                                                               {"MaxItems", 10}}}}}};
}

std::shared_ptr<tn::TNPlugInCore> typicalRecord() {
  auto record = tn::TNPlugInCore::create("com.example.mail.share",
                                         tn::URL::fileURLWithPath("/opt/tenon/applications/Mail/Support/PlugIns/Share.tnx"),
                                         tn::Value(typicalInfo()), tn::Value(), tn::UUID::random());
  record->setOriginalIdentifier("com.example.mail.share");
  record->setHubProtocolVersion(2);
  record->setLastModified(1700000000);
  record->setContainingUrl(tn::URL::fileURLWithPath("/opt/tenon/applications/Mail"));
  record->setEntitlements(tn::Value(tn::Dictionary{{"com.example.network", true}}));
  record->setLocalizedName("Teilen");
  record->setLocalizedShortName("Teilen");
  record->setLocalizedContainingName("Post");
  record->setLocalizedFileSourceActionNames(tn::Value(tn::Dictionary{}));
  record->setAnnotation("election", tn::Value(1));
  return record;
}

void BM_ExportAndImportForm(benchmark::State& state) {
  const std::shared_ptr<tn::TNPlugInCore> record = typicalRecord();
  for (auto _ : state) {
    tn::Result<tn::Dictionary> form = record->exportForm();
    std::shared_ptr<tn::TNPlugInCore> imported = tn::TNPlugInCore::createWithForm(tn::Value(std::move(*form)));
    benchmark::DoNotOptimize(imported);
  }
}
BENCHMARK(BM_ExportAndImportForm);

class OneSDK : public tn::TNRegistryLookup {
 public:
  explicit OneSDK(tn::Dictionary sdk) : sdk_(std::move(sdk)) {}
  std::optional<tn::Dictionary> sdkDictionary(std::string_view) const override { return sdk_; }
  std::optional<LocalizedStrings> localizedStrings(const tn::URL&, std::string_view,
                                                   const std::set<std::string, std::less<>>&) const override {
    return std::nullopt;
  }

 private:
  tn::Dictionary sdk_;
};

// 30 keys in all: 26 plug-in keys in "XTExtension" (attributes, "Shared",
// "CleanTimeout" and defaults) and four top-level ones.
tn::Dictionary thirtyKeySDK() {
  tn::Dictionary extension{{"XTExtensionProtocol", "com.example.share-protocol"},
                           {"CleanTimeout", 30},
                           {"Shared", tn::Array{"Templates", "Fonts"}},
                           {"XTExtensionAttributes", tn::Dictionary{{"MaxItems", 20}, {"Preview", true}}}};
  for (int i = 0; extension.size() < 26; ++i) extension.set(fmt::format("DefaultSetting{}", i), tn::Value(i));
  return tn::Dictionary{{"XTExtension", tn::Value(std::move(extension))},
                        {"BNBundleDevelopmentRegion", "en"},
                        {"MinimumSystemVersion", "1.0"},
                        {"BNBundlePackageType", "TNPI"}};
}

void BM_ResolveSDK(benchmark::State& state) {
  const OneSDK registry(thirtyKeySDK());
  const tn::Value info(typicalInfo());
  const tn::URL url = tn::URL::fileURLWithPath("/opt/tenon/applications/Mail/Support/PlugIns/Share.tnx");
  tn::TNPlugInCore record;
  record.setUrl(url);
  for (auto _ : state) {
    (void)record.setDictionaries(info);
    record.resolveSDK(registry);
    benchmark::DoNotOptimize(record.plugInDictionary());
  }
}
BENCHMARK(BM_ResolveSDK);

void BM_IssueFileExtension(benchmark::State& state) {
  std::string root = (std::filesystem::temp_directory_path() / "tenon-bench-XXXXXX").string();
  if (::mkdtemp(root.data()) == nullptr) {
    state.SkipWithError("cannot make a temporary root");
    return;
  }
  ::setenv("TENON_ROOT", root.c_str(), 1);
  std::filesystem::create_directories(root + "/opt/App/Support/PlugIns/Share.tnx/Resources");
  const tn::URL url = tn::URL::fileURLWithPath(root + "/opt/App/Support/PlugIns/Share.tnx/Resources");
  for (auto _ : state) {
    tn::Result<std::string> token = tn::issueFileExtension(url);
    benchmark::DoNotOptimize(token);
  }
  ::unsetenv("TENON_ROOT");
  std::filesystem::remove_all(root);
}
BENCHMARK(BM_IssueFileExtension);

}  // namespace
