// tnctl ready UUID=PATH... [--env JSON|@FILE] [--flags N]
//     make plug-ins launchable for the caller ("ready"); --env sends an
//     environment, which the daemon permits only with a host entitlement
// tnctl access UUID=PATH... [--flags N]
//     read access to the plug-ins' bundles ("access"): one token per line

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "tools/tnctl/Arguments.h"
#include "tools/tnctl/Command.h"
#include "tools/tnctl/DaemonSession.h"

namespace tnctl {
namespace {

struct PlugInsOptions {
  std::vector<std::string> plugins;
  std::optional<std::string> environment;
  std::string flags = "0";
};

std::shared_ptr<PlugInsOptions> addPlugInsCommand(CLI::App& app, const char* name, const char* description,
                                                  CLI::App*& command) {
  auto arguments = std::make_shared<PlugInsOptions>();
  command = app.add_subcommand(name, description);
  command->add_option("UUID=PATH", arguments->plugins, "Plug-ins by UUID and bundle path")->required();
  command->add_option("--flags", arguments->flags, "Flags (decimal or 0x hexadecimal)")->capture_default_str();
  return arguments;
}

void addReadyCommand(CLI::App& app, const GlobalOptions& options) {
  CLI::App* command = nullptr;
  auto arguments = addPlugInsCommand(app, "ready", "Make plug-ins launchable for this process", command);
  command->add_option("--env", arguments->environment, "Environment dictionary: JSON, or @FILE");
  command->callback([&options, arguments] {
    const tn::PlugInsByPath plugins = parsePlugIns(arguments->plugins);
    const uint64_t flags = parseFlags(arguments->flags);
    std::optional<tn::Dictionary> environment;
    if (arguments->environment) environment = readDictionaryArgument(*arguments->environment, "--env");
    runClientOperation(options, [&](tn::TNDaemonClient& client, tn::TNDaemonClient::ReplyBlock reply) {
      client.readyPlugIns(plugins, flags, environment, std::move(reply));
    });
  });
}

void addAccessCommand(CLI::App& app, const GlobalOptions& options) {
  CLI::App* command = nullptr;
  auto arguments = addPlugInsCommand(app, "access", "Get read access to plug-in bundles", command);
  command->callback([&options, arguments] {
    const tn::PlugInsByPath plugins = parsePlugIns(arguments->plugins);
    const uint64_t flags = parseFlags(arguments->flags);
    runClientOperation(options, [&](tn::TNDaemonClient& client, tn::TNDaemonClient::ReplyBlock reply) {
      client.accessPlugIns(plugins, flags, std::move(reply));
    });
  });
}

}  // namespace

void addReadinessCommands(CLI::App& app, const GlobalOptions& options) {
  addReadyCommand(app, options);
  addAccessCommand(app, options);
}

}  // namespace tnctl
