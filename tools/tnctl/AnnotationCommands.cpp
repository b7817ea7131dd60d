// tnctl annotate (--uuid U | --path P)... [--election N] [--extension JSON|@FILE]
//                [--annotations JSON|@FILE]
//     one annotation change for one or more plug-ins ("annotate"); prints
//     "annotated 2 plug-ins: {election: 0}"
// tnctl bulk-annotate JSON|@FILE
//     {"<UUID>": {extension dictionary}, ...} as a JSON or XML document
//     ("bulk-annotate"); prints "set the extension of 3 plug-ins"

#include <memory>
#include <string>
#include <vector>

#include <fmt/format.h>

#include "platform/value/MessageValue.h"
#include "tools/tnctl/Arguments.h"
#include "tools/tnctl/Command.h"
#include "tools/tnctl/DaemonSession.h"

namespace tnctl {
namespace {

struct AnnotateOptions {
  std::vector<std::string> uuids;
  std::vector<std::string> paths;
  std::string election;
  std::string extension;
  std::string annotations;
};

// The change: --annotations as given, with --election and --extension set
// over it.
tn::Dictionary annotationChange(const AnnotateOptions& arguments) {
  tn::Dictionary change;
  if (!arguments.annotations.empty()) change = readDictionaryArgument(arguments.annotations, "--annotations");
  if (!arguments.election.empty()) {
    const tn::Value election = readValueArgument(arguments.election, "--election");
    if (!election.isNumber()) fail(fmt::format("invalid election: {}", arguments.election));
    change.set("election", election);
  }
  if (!arguments.extension.empty()) {
    change.set("extension", tn::Value(readDictionaryArgument(arguments.extension, "--extension")));
  }
  return change;
}

// `uuids`, and, when plug-ins are named by path, the parallel `paths`: the
// daemon looks a plug-in up by its path when its UUID is unknown, so a
// plug-in named by path goes with the nil UUID, which names none, and one
// named by UUID with an empty path, which names nothing either.
void setPlugIns(tn::Dictionary& request, const AnnotateOptions& arguments) {
  const std::vector<tn::UUID> uuids = parseUUIDs(arguments.uuids);
  if (arguments.paths.empty()) return tn::TNDaemonClient::set(request, uuids);
  tn::PlugInsByPath plugIns;
  for (const tn::UUID& uuid : uuids) plugIns.emplace_back("", uuid);
  for (const std::string& path : absolutePaths(arguments.paths)) plugIns.emplace_back(path, tn::UUID());
  tn::TNDaemonClient::set(request, plugIns);
}

std::string plugInCount(size_t count) { return fmt::format("{} plug-in{}", count, count == 1 ? "" : "s"); }

void addAnnotateCommand(CLI::App& app, const GlobalOptions& options) {
  auto arguments = std::make_shared<AnnotateOptions>();
  CLI::App* command = app.add_subcommand("annotate", "Change the election or extension of plug-ins");
  CLI::Option* uuid = command->add_option("--uuid", arguments->uuids, "A plug-in's UUID (repeatable)");
  CLI::Option* path = command->add_option("--path", arguments->paths, "A plug-in bundle's path (repeatable)");
  CLI::Option* election = command->add_option("--election", arguments->election, "The election: 1 chosen, 0 not");
  CLI::Option* extension =
      command->add_option("--extension", arguments->extension, "The extension dictionary: JSON, XML or @FILE");
  CLI::Option* annotations =
      command->add_option("--annotations", arguments->annotations, "The whole change: JSON, XML or @FILE");
  command->callback([&options, arguments, uuid, path, election, extension, annotations] {
    if (uuid->count() + path->count() == 0) fail("name plug-ins with --uuid or --path");
    if (election->count() + extension->count() + annotations->count() == 0) {
      fail("nothing to change: give --election, --extension or --annotations");
    }
    const tn::Dictionary change = annotationChange(*arguments);
    const size_t count = arguments->uuids.size() + arguments->paths.size();
    runClientOperation(
        options,
        [&](tn::TNDaemonClient& client, tn::TNDaemonClient::ReplyBlock reply) {
          tn::Dictionary request = client.request("annotate");
          setPlugIns(request, *arguments);
          request.set("annotations", tn::convertMemoryToMessage(tn::Value(change)));
          client.send(std::move(request), std::move(reply));
        },
        fmt::format("annotated {}: {}", plugInCount(count), tn::Value(change)));
  });
}

void addBulkAnnotateCommand(CLI::App& app, const GlobalOptions& options) {
  auto annotations = std::make_shared<std::string>();
  CLI::App* command = app.add_subcommand("bulk-annotate", "Set the extension annotations of many plug-ins");
  command->add_option("ANNOTATIONS", *annotations,
                      "UUID string to extension dictionary: a JSON or XML document, or @FILE")
      ->required();
  command->callback([&options, annotations] {
    const tn::Dictionary value = readDictionaryArgument(*annotations, "ANNOTATIONS");
    runClientOperation(
        options,
        [&](tn::TNDaemonClient& client, tn::TNDaemonClient::ReplyBlock reply) {
          client.bulkSetPluginAnnotations(value, std::move(reply));
        },
        fmt::format("set the extension of {}", plugInCount(value.size())));
  });
}

}  // namespace

void addAnnotationCommands(CLI::App& app, const GlobalOptions& options) {
  addAnnotateCommand(app, options);
  addBulkAnnotateCommand(app, options);
}

}  // namespace tnctl
