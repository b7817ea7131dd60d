// tnctl add PATH...       register plug-in bundles ("add")
// tnctl remove PATH...    unregister them ("remove"; the daemon requires the
//                         manager entitlement)
// tnctl bulk [--flags N]  bulk options ("bulk"; the daemon supports none)

#include <memory>
#include <string>
#include <vector>

#include "tools/tnctl/Arguments.h"
#include "tools/tnctl/Command.h"
#include "tools/tnctl/DaemonSession.h"

namespace tnctl {
namespace {

struct PathsOptions {
  std::vector<std::string> paths;
};

void addPathsCommand(CLI::App& app, const GlobalOptions& options, const char* name, const char* description,
                     void (tn::TNDaemonClient::*operation)(const std::vector<std::string>&,
                                                           tn::TNDaemonClient::ReplyBlock)) {
  auto arguments = std::make_shared<PathsOptions>();
  CLI::App* command = app.add_subcommand(name, description);
  command->add_option("PATH", arguments->paths, "Plug-in bundle paths")->required();
  command->callback([&options, arguments, operation] {
    const std::vector<std::string> paths = absolutePaths(arguments->paths);
    runClientOperation(options, [&](tn::TNDaemonClient& client, tn::TNDaemonClient::ReplyBlock reply) {
      (client.*operation)(paths, std::move(reply));
    });
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
