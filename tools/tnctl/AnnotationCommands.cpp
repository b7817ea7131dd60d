// tnctl annotate --uuid U... --annotations JSON|@FILE
//     one annotation change ({"election": 1}, {"extension": {...}}) for
//     the plug-ins ("annotate")
// tnctl bulk-annotate JSON|@FILE
//     {"<UUID>": {extension dictionary}, ...} ("bulk-annotate")

#include <memory>
#include <string>
#include <vector>

#include "tools/tnctl/Arguments.h"
#include "tools/tnctl/Command.h"
#include "tools/tnctl/DaemonSession.h"

namespace tnctl {
namespace {

struct AnnotateOptions {
  std::vector<std::string> uuids;
  std::string annotations;
};

void addAnnotateCommand(CLI::App& app, const GlobalOptions& options) {
  auto arguments = std::make_shared<AnnotateOptions>();
  CLI::App* command = app.add_subcommand("annotate", "Change the annotations of plug-ins");
  command->add_option("--uuid", arguments->uuids, "A plug-in's UUID (repeatable)");
  command->add_option("--annotations", arguments->annotations, "The change: JSON, or @FILE")->required();
  command->callback([&options, arguments] {
    const std::vector<tn::UUID> uuids = parseUUIDs(arguments->uuids);
    const tn::Dictionary annotations = readDictionaryArgument(arguments->annotations, "--annotations");
    runClientOperation(options, [&](tn::TNDaemonClient& client, tn::TNDaemonClient::ReplyBlock reply) {
      client.setPluginAnnotations(uuids, annotations, std::move(reply));
    });
  });
}

void addBulkAnnotateCommand(CLI::App& app, const GlobalOptions& options) {
  auto annotations = std::make_shared<std::string>();
  CLI::App* command = app.add_subcommand("bulk-annotate", "Set the extension annotations of many plug-ins");
  command->add_option("ANNOTATIONS", *annotations, "UUID string to extension dictionary: JSON, or @FILE")
      ->required();
  command->callback([&options, annotations] {
    const tn::Dictionary value = readDictionaryArgument(*annotations, "ANNOTATIONS");
    runClientOperation(options, [&](tn::TNDaemonClient& client, tn::TNDaemonClient::ReplyBlock reply) {
      client.bulkSetPluginAnnotations(value, std::move(reply));
    });
  });
}

}  // namespace

void addAnnotationCommands(CLI::App& app, const GlobalOptions& options) {
  addAnnotateCommand(app, options);
  addBulkAnnotateCommand(app, options);
}

}  // namespace tnctl
