// tnctl registry list | show UUID|PATH | scan: the registrar's store, read
// directly (no daemon needed). list and show open the store read-only; scan
// opens it read-write and re-reads the roots like the daemon does at start.

#include <unistd.h>

#include <cstdio>
#include <string>

#include <fmt/format.h>

#include "platform/registrar/Registrar.h"
#include "platform/value/Document.h"
#include "tools/tnctl/Command.h"
#include "tools/tnctl/DisplayDate.h"

namespace tnctl {
namespace {

std::shared_ptr<registrar::Registrar> openRegistrar(registrar::Registrar::Mode mode) {
  registrar::Registrar::Options options;
  options.mode = mode;
  options.watch = false;
  options.initialScan = registrar::Registrar::InitialScan::None;
  tn::Result<std::shared_ptr<registrar::Registrar>> opened =
      registrar::Registrar::open(registrar::RegistrarPaths::fromEnvironment(), options);
  if (!opened) fail(opened.error().message().value_or(opened.error().description()));
  return *opened;
}

tn::Value optionalString(const std::optional<std::string>& text) { return text ? tn::Value(*text) : tn::Value(); }

tn::Value describe(const registrar::PlugInRecord& plugIn) {
  return tn::Dictionary{
      {"identifier", plugIn.identifier()},
      {"bundleIdentifier", optionalString(plugIn.bundleIdentifier())},
      {"version", optionalString(plugIn.bundleVersion())},
      {"uuid", plugIn.uuid().string()},
      {"path", plugIn.bundlePath()},
      {"application", plugIn.containingApp() ? tn::Value(plugIn.containingApp()->bundlePath()) : tn::Value()},
      {"placeholder", plugIn.containingApp() && plugIn.containingApp()->isPlaceholder()},
      {"systemVolume", plugIn.onSystemPartition()},
      {"localizedName", optionalString(plugIn.localizedName())},
      {"dataContainer", optionalString(plugIn.dataContainerPath())},
      {"registered", displayDate(plugIn.registrationDate())},
  };
}

tn::Value describe(const registrar::AppRecord& app, const registrar::Registrar& registry) {
  tn::Array plugIns;
  for (const registrar::PlugInPtr& plugIn : registry.plugInsOfApplication(app)) plugIns.push_back(describe(*plugIn));
  return tn::Dictionary{
      {"identifier", optionalString(app.identifier())},
      {"path", app.bundlePath()},
      {"placeholder", app.isPlaceholder()},
      {"systemVolume", app.onSystemPartition()},
      {"localizedName", optionalString(app.localizedName())},
      {"plugIns", std::move(plugIns)},
  };
}

void printJson(const tn::Value& value) { printJsonDocument(value); }

std::string flags(bool placeholder, bool system) {
  std::string text;
  if (placeholder) text += " [placeholder]";
  if (system) text += " [system]";
  return text;
}

void printPlugInLine(const registrar::PlugInRecord& plugIn, std::string_view indent) {
  fmt::print("{}{} {} {} {}{}\n", indent, plugIn.identifier(), plugIn.bundleVersion().value_or("-"),
             plugIn.uuid(), plugIn.bundlePath(),
             flags(plugIn.containingApp() && plugIn.containingApp()->isPlaceholder(), plugIn.onSystemPartition()));
}

void list(const GlobalOptions& options) {
  const auto registry = openRegistrar(registrar::Registrar::Mode::ReadOnly);
  tn::Array apps;
  tn::Array loose;
  for (const registrar::AppPtr& app : registry->applications()) apps.push_back(describe(*app, *registry));
  for (const registrar::PlugInPtr& plugIn : registry->installedPlugIns()) {
    if (!plugIn->containingApp()) loose.push_back(describe(*plugIn));
  }
  if (options.json) {
    printJson(tn::Dictionary{{"knowledge", registry->knowledgeUUID().string()},
                             {"applications", std::move(apps)},
                             {"plugIns", std::move(loose)}});
    return;
  }
  for (const registrar::AppPtr& app : registry->applications()) {
    fmt::print("{} {}{}\n", app->identifier().value_or("-"), app->bundlePath(),
               flags(app->isPlaceholder(), app->onSystemPartition()));
    for (const registrar::PlugInPtr& plugIn : registry->plugInsOfApplication(*app)) printPlugInLine(*plugIn, "  ");
  }
  for (const registrar::PlugInPtr& plugIn : registry->installedPlugIns()) {
    if (!plugIn->containingApp()) printPlugInLine(*plugIn, "");
  }
}

void show(const GlobalOptions& options, const std::string& what) {
  const auto registry = openRegistrar(registrar::Registrar::Mode::ReadOnly);
  registrar::PlugInPtr plugIn;
  if (const std::optional<tn::UUID> uuid = tn::UUID::parse(what)) {
    plugIn = registry->plugInForUUID(*uuid);
  } else {
    plugIn = registry->plugInForURL(tn::URL::fileURLWithPath(what));
    if (!plugIn) {
      if (const registrar::AppPtr app = registry->applicationForURL(tn::URL::fileURLWithPath(what))) {
        const tn::Value described = describe(*app, *registry);
        if (options.json) {
          printJson(described);
        } else {
          fmt::print("{}\n", described);
        }
        return;
      }
    }
  }
  if (!plugIn) fail(fmt::format("no plug-in or application {} in the registry", what));
  tn::Value described = describe(*plugIn);
  described.editDictionary()->set("entitlements", plugIn->entitlements());
  described.editDictionary()->set("info", plugIn->infoDictionary());
  if (options.json) {
    printJson(described);
    return;
  }
  for (const auto& [key, value] : *described.dictionary()) {
    if (value.isNull()) continue;
    fmt::print("{}: {}\n", key, value.isString() ? *value.string() : value.description());
  }
}

void scan(const GlobalOptions& options) {
  const auto registry = openRegistrar(registrar::Registrar::Mode::ReadWrite);
  const bool terminal = ::isatty(STDERR_FILENO) != 0;
  registrar::Registrar::Progress progress;
  if (terminal) {
    progress = [](size_t done, size_t total) { fmt::print(stderr, "\rscanning applications: {}/{}", done, total); };
  }
  tn::Result<registrar::ScanSummary> summary = registry->scan(progress);
  if (terminal) fmt::print(stderr, "\n");
  if (!summary) fail(summary.error().message().value_or(summary.error().description()));
  if (options.json) {
    printJson(tn::Dictionary{{"applications", summary->applications},
                             {"plugIns", summary->plugIns},
                             {"installed", summary->installed},
                             {"uninstalled", summary->uninstalled},
                             {"skipped", summary->skipped},
                             {"knowledge", registry->knowledgeUUID().string()}});
    return;
  }
  fmt::print("{} applications, {} plug-ins: {} installed, {} uninstalled, {} skipped\n", summary->applications,
             summary->plugIns, summary->installed, summary->uninstalled, summary->skipped);
}

}  // namespace

void addRegistryCommands(CLI::App& app, const GlobalOptions& options) {
  CLI::App* registry = app.add_subcommand("registry", "Read the registry of installed plug-ins (no daemon needed)");
  registry->require_subcommand(1);
  registry->add_subcommand("list", "List applications and plug-ins")->callback([&options] { list(options); });
  auto* showCommand = registry->add_subcommand("show", "Show one plug-in (by UUID or path) or application");
  auto target = std::make_shared<std::string>();
  showCommand->add_option("target", *target, "A plug-in UUID or a bundle path")->required();
  showCommand->callback([&options, target] { show(options, *target); });
  registry->add_subcommand("scan", "Re-read the application roots into the registry")->callback([&options] {
    scan(options);
  });
}

}  // namespace tnctl
