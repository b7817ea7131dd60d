// tnctl request JSON|@FILE
//
// Sends a request dictionary exactly as given, envelope included: nothing
// is added, so a request without "version", or with a wrong one, reaches the
// daemon as it is, which is how the daemon's envelope errors are tried out.
// JSON cannot express UUIDs or data; an XML document file can. When the
// daemon refuses a request that has no "version" key, tnctl says that the
// key is missing (the daemon reads a missing version as version 0).

#include <memory>

#include <fmt/format.h>
#include <string>

#include "tools/tnctl/Arguments.h"
#include "tools/tnctl/Command.h"
#include "tools/tnctl/DaemonSession.h"

namespace tnctl {
namespace {

constexpr std::string_view kVersionKey = "version";
constexpr int64_t kProtocolVersionErrorCode = 7;  // docs/protocol.md, error codes

FailureExplainer missingVersionExplainer(const tn::Dictionary& request) {
  if (request.find(kVersionKey) != nullptr) return {};
  return [](const tn::Error& error) -> std::optional<std::string> {
    if (error.code() != kProtocolVersionErrorCode) return std::nullopt;
    return fmt::format("tnctl: the request has no \"{}\" key (the current protocol version is {})", kVersionKey,
                       tn::TNDaemonClient::kCurrentProtocolVersion);
  };
}

}  // namespace

void addRequestCommand(CLI::App& app, const GlobalOptions& options) {
  auto text = std::make_shared<std::string>();
  CLI::App* command = app.add_subcommand("request", "Send a raw request dictionary to tenond");
  command->add_option("REQUEST", *text, "The request dictionary: JSON, or @FILE")->required();
  command->callback([&options, text] {
    const tn::Dictionary request = readDictionaryArgument(*text, "REQUEST");
    ReplyHandling handling;
    handling.explainFailure = missingVersionExplainer(request);
    runClientOperation(options, [&](tn::TNDaemonClient& client, tn::TNDaemonClient::ReplyBlock reply) {
      client.send(request, std::move(reply));
    }, handling);
  });
}

}  // namespace tnctl
