// tnctl lint BUNDLE|MANIFEST [--extension-points DIR] [--json]
//
// Checks a plug-in bundle the way the registry will see it, before it ships
// (BundleLint.h). Prints "ok" with the identifier, version, protocol and
// attributes, exit status 0; or exit status 1 when it finds an error. Every
// finding is a "tnctl: <bundle>: …" line on stderr (warnings, keys the
// system does not read, do not fail the check). With --json, stdout holds
// one JSON document either way.

#include <cstdio>

#include <fmt/format.h>

#include "tools/tnctl/BundleLint.h"
#include "tools/tnctl/Command.h"

namespace tnctl {
namespace {

struct LintOptions {
  std::string bundle;
  std::string extensionPoints;
};

std::string text(const tn::Value& value) { return value.string() ? *value.string() : value.description(); }

bool isError(const LintFinding& finding) { return finding.severity == LintFinding::Severity::Error; }

tn::Array findingsDocument(const std::vector<LintFinding>& findings) {
  tn::Array document;
  for (const LintFinding& finding : findings) {
    document.push_back(tn::Dictionary{{"severity", isError(finding) ? "error" : "warning"},
                                      {"message", finding.message}});
  }
  return document;
}

void printJsonReport(const BundleLintResult& result) {
  tn::Dictionary report{{"ok", result.record != nullptr}, {"path", result.path}};
  if (const tn::TNPlugInCore* record = result.record.get()) {
    report.set("identifier", record->identifier().value_or(""));
    report.set("version", record->version());
    report.set("protocol", record->protocolSpec());
    report.set("attributes", record->attributes());
  } else {
    const auto first = std::ranges::find_if(result.findings, isError);
    report.set("errorcode", result.errorcode);
    report.set("error", first != result.findings.end() ? first->message : std::string());
  }
  report.set("findings", findingsDocument(result.findings));
  printJsonDocument(tn::Value(std::move(report)));
}

void printFindings(const BundleLintResult& result) {
  for (const LintFinding& finding : result.findings) {
    fmt::print(stderr, "tnctl: {}: {}{}\n", result.path, isError(finding) ? "" : "warning: ", finding.message);
  }
}

void printReadableReport(const BundleLintResult& result) {
  if (const tn::TNPlugInCore* record = result.record.get()) {
    fmt::print("ok\nidentifier: {}\nversion: {}\nprotocol: {}\nattributes: {}\n", record->identifier().value_or(""),
               text(record->version()), text(record->protocolSpec()), record->attributes());
  }
}

void runLint(const LintOptions& options, bool json) {
  const BundleLintResult result = lintBundle(options.bundle, options.extensionPoints);
  printFindings(result);  // for people, also under --json
  if (json) {
    printJsonReport(result);
  } else {
    printReadableReport(result);
  }
  if (!result.record) throw CommandFailed{kFailureStatus};
}

}  // namespace

void addLintCommand(CLI::App& app, const GlobalOptions& globalOptions) {
  auto options = std::make_shared<LintOptions>();
  CLI::App* command = app.add_subcommand("lint", "Check a plug-in bundle as the registry will see it");
  command->add_option("BUNDLE", options->bundle, "The plug-in bundle directory, or its Info.manifest")->required();
  command->add_option("--extension-points", options->extensionPoints,
                      "Read extension points' definitions (<identifier>.manifest) from this directory "
                      "instead of the platform root's");
  command->callback([options, &globalOptions] { runLint(*options, globalOptions.json); });
}

}  // namespace tnctl
