#include "tools/tnctl/BundleLint.h"

#include <filesystem>
#include <optional>

#include <fmt/format.h>

#include "libtenon/model/PlugInKeys.h"
#include "platform/bundle/Bundle.h"
#include "platform/bundle/BundleLayout.h"
#include "platform/bundle/BundlePaths.h"
#include "tools/tnctl/RegistryLookup.h"

namespace tnctl {
namespace {

// The identifier the registry would give the plug-in: its
// "XTExtensionIdentifier", else the bundle's "BNBundleIdentifier".
std::optional<std::string> plugInIdentifier(const tn::Value& info) {
  if (const std::string* identifier = info[tn::keys::kXTExtension][tn::keys::kIdentifier].string()) return *identifier;
  if (const std::string* identifier = info[tn::keys::kBundleIdentifier].string()) return *identifier;
  return std::nullopt;
}

// Why a bundle has no record at all; none when it has one, or when its
// "XTExtension" is there but of the wrong kind (a finding of its own).
std::optional<std::string> missingPlugInDictionary(const tn::Value& info) {
  if (!info[tn::keys::kXTExtension].isNull()) return std::nullopt;
  if (!info[tn::keys::kTenon].isNull()) {
    return fmt::format("old-style plug-in: Info.manifest has \"{}\" but no \"{}\" dictionary", tn::keys::kTenon,
                       tn::keys::kXTExtension);
  }
  return fmt::format("malformed plug-in dictionary: Info.manifest has no \"{}\" dictionary", tn::keys::kXTExtension);
}

// The record as the registry builds it, before SDK resolution. A plug-in
// without any identifier still gets a record, so that diagnose names the
// missing identifier.
std::shared_ptr<tn::TNPlugInCore> buildRecord(const std::string& path, const tn::Value& info) {
  const tn::URL url = tn::URL::fileURLWithPath(path);
  if (std::optional<std::string> identifier = plugInIdentifier(info)) {
    return tn::TNPlugInCore::create(identifier, url, info, tn::Value(), std::nullopt);
  }
  auto record = std::make_shared<tn::TNPlugInCore>();
  record->setUrl(url);
  record->setUuid(tn::UUID::random());
  if (!record->setDictionaries(info)) return nullptr;
  return record;
}

// The bundle directory: `given`, or the directory of the Info.manifest given.
std::string bundleDirectory(const std::string& given) {
  const std::filesystem::path path(given);
  std::error_code error;
  if (path.filename() == bundle::kInfoManifestName && std::filesystem::is_regular_file(path, error)) {
    return path.parent_path().empty() ? std::string(".") : path.parent_path().string();
  }
  return given;
}

class Linter {
 public:
  explicit Linter(BundleLintResult& result) : result_(result) {}

  void add(LintFinding finding, int64_t code = tn::kUnusablePlugInErrorCode) {
    if (finding.severity == LintFinding::Severity::Error && result_.errorcode == 0) result_.errorcode = code;
    result_.findings.push_back(std::move(finding));
  }
  void error(std::string message, int64_t code = tn::kUnusablePlugInErrorCode) {
    add(LintFinding{LintFinding::Severity::Error, std::move(message)}, code);
  }
  bool failed() const { return result_.errorcode != 0; }

 private:
  BundleLintResult& result_;
};

void lintRecord(const tn::Value& info, const tn::TNRegistryLookup& lookup, BundleLintResult& result, Linter& lint) {
  const std::shared_ptr<tn::TNPlugInCore> record = buildRecord(result.path, info);
  if (!record) return lint.error("the plug-in record cannot be built");
  record->resolveSDK(lookup);
  if (std::optional<tn::Error> problem = record->diagnose()) {
    return lint.error(problem->localizedDescription(), problem->code());
  }
  if (!record->isData()) {
    if (std::optional<LintFinding> executable = checkExecutable(result.path, record->bundleInfoDictionary())) {
      return lint.add(std::move(*executable));
    }
  }
  result.record = record;
}

}  // namespace

BundleLintResult lintBundle(const std::string& given, const std::string& extensionPoints) {
  BundleLintResult result;
  Linter lint(result);
  result.path = bundle::absoluteBundlePath(bundleDirectory(given));
  const std::shared_ptr<bundle::Bundle> plugIn = bundle::Bundle::create(result.path, bundle::CreateMode::BundlePath);
  if (!plugIn) {
    lint.error("no such bundle (give the bundle directory or its Info.manifest)");
    return result;
  }
  tn::Result<tn::Value> info = plugIn->readInfoDictionary();
  if (!info) {
    lint.error(info.error().localizedDescription(), info.error().code());
    return result;
  }
  for (LintFinding& finding : checkManifestKeys(*info)) lint.add(std::move(finding));
  if (std::optional<std::string> missing = missingPlugInDictionary(*info)) lint.error(*missing);
  // The extension points are read once, for both questions that need them.
  const std::unique_ptr<tn::TNRegistryLookup> lookup = makeRegistryLookup(extensionPoints);
  if (std::optional<LintFinding> point = checkExtensionPoint(*info, *lookup)) {
    lint.add(std::move(*point));
  }
  // The record's diagnosis would speak of what the author did not write (a
  // key an SDK supplies, a key of the wrong kind as missing): only a
  // manifest without such errors gets it.
  if (!lint.failed()) lintRecord(*info, *lookup, result, lint);
  return result;
}

}  // namespace tnctl
