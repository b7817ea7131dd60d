// tnctl find --uuid U | --url URL             one plug-in's form ("find")

#include <memory>
#include <string>

#include "tools/tnctl/Arguments.h"
#include "tools/tnctl/Command.h"
#include "tools/tnctl/DaemonSession.h"

namespace tnctl {
namespace {

struct FindOptions {
  std::string uuid;
  std::string url;
};

void addFindCommand(CLI::App& app, const GlobalOptions& options) {
  auto arguments = std::make_shared<FindOptions>();
  CLI::App* command = app.add_subcommand("find", "Look up one plug-in by UUID or by bundle URL");
  CLI::Option* uuid = command->add_option("--uuid", arguments->uuid, "The plug-in's UUID");
  CLI::Option* url = command->add_option("--url", arguments->url, "The bundle's URL (or path)");
  uuid->excludes(url);
  command->require_option(1);
  command->callback([&options, arguments] {
    if (!arguments->uuid.empty()) {
      const tn::UUID value = parseUUID(arguments->uuid);
      runClientOperation(options, [&](tn::TNDaemonClient& client, tn::TNDaemonClient::ReplyBlock reply) {
        client.findPlugInByUUID(value, std::move(reply));
      });
      return;
    }
    const tn::URL value = parseURLOrPath(arguments->url);
    runClientOperation(options, [&](tn::TNDaemonClient& client, tn::TNDaemonClient::ReplyBlock reply) {
      client.findPlugInByPathURL(value, std::move(reply));
    });
  });
}

}  // namespace

void addLookupCommands(CLI::App& app, const GlobalOptions& options) {
  addFindCommand(app, options);
}

}  // namespace tnctl
