// tnctl add PATH...       register plug-in bundles ("add"); when the
//                         registrar refuses one, the daemon's reply says
//                         only which, so tnctl lints it to say why
// tnctl remove PATH...    unregister them ("remove"; the daemon requires the
//                         manager entitlement)
// tnctl bulk [--flags N]  bulk options ("bulk"; the daemon supports none)

#include <algorithm>
#include <memory>
#include <string>
#include <vector>

#include <fmt/format.h>

#include "tools/tnctl/Arguments.h"
#include "tools/tnctl/BundleLint.h"
#include "tools/tnctl/Command.h"
#include "tools/tnctl/DaemonSession.h"

namespace tnctl {
namespace {

struct PathsOptions {
  std::vector<std::string> paths;
};

constexpr int64_t kRegistrationErrorCode = 2;  // docs/protocol.md, error codes

// Why the registrar refused the bundle the error names ("unable to
// register plug-in at PATH"), as lint finds it.
std::optional<std::string> refusalReasons(const std::vector<std::string>& paths, const tn::Error& error) {
  if (error.code() != kRegistrationErrorCode) return std::nullopt;
  const std::string message = error.localizedDescription();
  auto refused = std::ranges::find_if(paths, [&](const std::string& path) { return message.ends_with(path); });
  // The daemon names the path it resolved; one path given is the one.
  if (refused == paths.end() && paths.size() == 1) refused = paths.begin();
  if (refused == paths.end()) return std::nullopt;
  const BundleLintResult lint = lintBundle(*refused, {});
  std::string reasons;
  for (const LintFinding& finding : lint.findings) {
    if (finding.severity != LintFinding::Severity::Error) continue;
    reasons += fmt::format("{}tnctl: {}: {}", reasons.empty() ? "" : "\n", lint.path, finding.message);
  }
  if (reasons.empty()) {
    return fmt::format("tnctl: {}: tnctl lint finds nothing wrong with it; tenond's log has the registrar's reason",
                       lint.path);
  }
  return reasons;
}

void addPathsCommand(CLI::App& app, const GlobalOptions& options, const char* name, const char* description,
                     void (tn::TNDaemonClient::*operation)(const std::vector<std::string>&,
                                                           tn::TNDaemonClient::ReplyBlock)) {
  auto arguments = std::make_shared<PathsOptions>();
  CLI::App* command = app.add_subcommand(name, description);
  command->add_option("PATH", arguments->paths, "Plug-in bundle paths")->required();
  command->callback([&options, arguments, operation] {
    const std::vector<std::string> paths = absolutePaths(arguments->paths);
    ReplyHandling handling;
    handling.explainFailure = [&paths](const tn::Error& error) { return refusalReasons(paths, error); };
    runClientOperation(options, [&](tn::TNDaemonClient& client, tn::TNDaemonClient::ReplyBlock reply) {
      (client.*operation)(paths, std::move(reply));
    }, handling);
  });
}

void addBulkCommand(CLI::App& app, const GlobalOptions& options) {
  auto flags = std::make_shared<std::string>("0");
  CLI::App* command = app.add_subcommand("bulk", "Send bulk options to tenond");
  command->add_option("--flags", *flags, "Bulk options (decimal or 0x hexadecimal)")->capture_default_str();
  command->callback([&options, flags] {
    const uint64_t value = parseFlags(*flags);
    runClientOperation(options, [&](tn::TNDaemonClient& client, tn::TNDaemonClient::ReplyBlock reply) {
      client.bulkPlugins(value, std::move(reply));
    });
  });
}

}  // namespace

void addRegistrationCommands(CLI::App& app, const GlobalOptions& options) {
  addPathsCommand(app, options, "add", "Register plug-in bundles with tenond", &tn::TNDaemonClient::addPlugIns);
  addPathsCommand(app, options, "remove", "Unregister plug-in bundles", &tn::TNDaemonClient::removePlugIns);
  addBulkCommand(app, options);
}

}  // namespace tnctl
