// tnctl request JSON|@FILE
//
// Sends a request dictionary exactly as given, envelope included: nothing
// is added, so a request without "version", or with a wrong one, reaches the
// daemon as it is, which is how the daemon's envelope errors are tried out.
// JSON cannot express UUIDs or data; an XML document file can.

#include <memory>
#include <string>

#include "tools/tnctl/Arguments.h"
#include "tools/tnctl/Command.h"
#include "tools/tnctl/DaemonSession.h"

namespace tnctl {

void addRequestCommand(CLI::App& app, const GlobalOptions& options) {
  auto text = std::make_shared<std::string>();
  CLI::App* command = app.add_subcommand("request", "Send a raw request dictionary to tenond");
  command->add_option("REQUEST", *text, "The request dictionary: JSON, or @FILE")->required();
  command->callback([&options, text] {
    const tn::Dictionary request = readDictionaryArgument(*text, "REQUEST");
    runClientOperation(options, [&](tn::TNDaemonClient& client, tn::TNDaemonClient::ReplyBlock reply) {
      client.send(request, std::move(reply));
    });
  });
}

}  // namespace tnctl
