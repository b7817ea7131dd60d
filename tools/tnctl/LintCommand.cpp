// tnctl lint BUNDLE [--json]
//
// Checks a plug-in bundle the way the registry will see it, before it ships:
// reads its Info.manifest, builds its record, merges the SDK of its extension
// point (RegistryLookup.h says where SDKs are read from), canonicalises it
// and runs the record's diagnosis. Prints "ok" with the identifier, version,
// protocol and attributes, exit status 0; or the diagnosis message, exit
// status 1. With --json, one JSON document either way.

#include <fmt/format.h>

#include "libtenon/model/PlugInKeys.h"
#include "libtenon/model/TNPlugInCore.h"
#include "platform/bundle/Bundle.h"
#include "platform/bundle/BundlePaths.h"
#include "platform/value/Document.h"
#include "tools/tnctl/Command.h"
#include "tools/tnctl/RegistryLookup.h"

namespace tnctl {
namespace {

struct LintOptions {
  std::string bundle;
};

// The identifier the registry would give the plug-in: its
// "XTExtensionIdentifier", else the bundle's "BNBundleIdentifier".
std::optional<std::string> plugInIdentifier(const tn::Value& info) {
  if (const std::string* identifier = info[tn::keys::kXTExtension][tn::keys::kIdentifier].string()) return *identifier;
  if (const std::string* identifier = info[tn::keys::kBundleIdentifier].string()) return *identifier;
  return std::nullopt;
}

// Why a bundle has no record at all; none when it has one.
std::optional<std::string> missingPlugInDictionary(const tn::Value& info) {
  if (info[tn::keys::kXTExtension].isDictionary()) return std::nullopt;
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

void noteUnregisteredSDK(const tn::TNPlugInCore& record, const tn::TNRegistryLookup& registry) {
  const tn::Value spec = record.sdkSpec();
  if (const std::string* identifier = spec.string(); identifier && !registry.sdkDictionary(*identifier)) {
    fmt::print(stderr, "tnctl: note: extension point \"{}\" is not registered; checked without its SDK\n", *identifier);
  }
}

std::string text(const tn::Value& value) { return value.string() ? *value.string() : value.description(); }

void printJson(const tn::Dictionary& report) {
  tn::Result<std::string> json = tn::writeJsonDocument(tn::Value(report));
  if (!json) fail("cannot write the report as JSON: " + json.error().localizedDescription());
  fmt::print("{}", *json);
}

[[noreturn]] void reportProblem(const std::string& path, int64_t code, const std::string& message, bool json) {
  if (!json) fail(fmt::format("{}: {}", path, message));
  printJson(tn::Dictionary{{"ok", false}, {"path", path}, {"errorcode", code}, {"error", message}});
  throw CommandFailed{};
}

void reportUsable(const std::string& path, const tn::TNPlugInCore& record, bool json) {
  const std::string identifier = record.identifier().value_or("");
  if (json) {
    return printJson(tn::Dictionary{{"ok", true},
                                    {"path", path},
                                    {"identifier", identifier},
                                    {"version", record.version()},
                                    {"protocol", record.protocolSpec()},
                                    {"attributes", record.attributes()}});
  }
  fmt::print("ok\nidentifier: {}\nversion: {}\nprotocol: {}\nattributes: {}\n", identifier, text(record.version()),
             text(record.protocolSpec()), record.attributes());
}

void runLint(const LintOptions& options, bool json) {
  const std::string path = bundle::absoluteBundlePath(options.bundle);
  const std::shared_ptr<bundle::Bundle> plugIn = bundle::Bundle::create(path, bundle::CreateMode::BundlePath);
  if (!plugIn) fail(fmt::format("{}: no such bundle", path));
  tn::Result<tn::Value> info = plugIn->readInfoDictionary();
  if (!info) reportProblem(path, info.error().code(), info.error().localizedDescription(), json);
  if (std::optional<std::string> missing = missingPlugInDictionary(*info)) {
    reportProblem(path, tn::kUnusablePlugInErrorCode, *missing, json);
  }
  const std::shared_ptr<tn::TNPlugInCore> record = buildRecord(path, *info);
  if (!record) reportProblem(path, tn::kUnusablePlugInErrorCode, "the plug-in record cannot be built", json);

  const std::unique_ptr<tn::TNRegistryLookup> registry = makeRegistryLookup();
  noteUnregisteredSDK(*record, *registry);
  record->resolveSDK(*registry);
  if (std::optional<tn::Error> problem = record->diagnose()) {
    reportProblem(path, problem->code(), problem->localizedDescription(), json);
  }
  reportUsable(path, *record, json);
}

}  // namespace

void addLintCommand(CLI::App& app, const GlobalOptions& globalOptions) {
  auto options = std::make_shared<LintOptions>();
  CLI::App* command = app.add_subcommand("lint", "Check a plug-in bundle as the registry will see it");
  command->add_option("BUNDLE", options->bundle, "The plug-in bundle directory")->required();
  command->callback([options, &globalOptions] { runLint(*options, globalOptions.json); });
}

}  // namespace tnctl
