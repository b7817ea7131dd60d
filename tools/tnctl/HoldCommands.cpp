// tnctl hold PATH... [--flags N]   put plug-ins on hold ("lock"); prints the
//                                  hold's token. Flags: 0x1 the paths are
//                                  plug-ins (else applications), 0x2 refuse
//                                  when busy, 0x4 terminate running instances
// tnctl release TOKEN              end a hold ("lock", release form)

#include <memory>
#include <string>
#include <vector>

#include "tools/tnctl/Arguments.h"
#include "tools/tnctl/Command.h"
#include "tools/tnctl/DaemonSession.h"

namespace tnctl {
namespace {

struct HoldOptions {
  std::vector<std::string> paths;
  std::string flags = "0";
};

void addHoldCommand(CLI::App& app, const GlobalOptions& options) {
  auto arguments = std::make_shared<HoldOptions>();
  CLI::App* command = app.add_subcommand("hold", "Put plug-ins on hold");
  command->add_option("PATH", arguments->paths, "Application (or, with 0x1, plug-in) bundle paths");
  command->add_option("--flags", arguments->flags, "Hold flags (decimal or 0x hexadecimal)")->capture_default_str();
  command->callback([&options, arguments] {
    const std::vector<std::string> paths = absolutePaths(arguments->paths);
    const uint64_t flags = parseFlags(arguments->flags);
    runClientOperation(options, [&](tn::TNDaemonClient& client, tn::TNDaemonClient::ReplyBlock reply) {
      client.holdPlugins(paths, flags, std::move(reply));
    });
  });
}

void addReleaseCommand(CLI::App& app, const GlobalOptions& options) {
  auto token = std::make_shared<std::string>();
  CLI::App* command = app.add_subcommand("release", "End a hold");
  command->add_option("TOKEN", *token, "The hold's token (a UUID)")->required();
  command->callback([&options, token] {
    const tn::UUID value = parseUUID(*token);
    runClientOperation(options, [&](tn::TNDaemonClient& client, tn::TNDaemonClient::ReplyBlock reply) {
      client.releaseHold(value, std::move(reply));
    });
  });
}

}  // namespace

void addHoldCommands(CLI::App& app, const GlobalOptions& options) {
  addHoldCommand(app, options);
  addReleaseCommand(app, options);
}

}  // namespace tnctl
