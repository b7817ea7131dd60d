#include "tools/tnctl/DaemonSession.h"

#include <chrono>
#include <optional>

#include <fmt/format.h>

#include "libtenon/client/BlockingReply.h"
#include "libtenon/client/InternalInconsistency.h"
#include "tools/tnctl/ReplyPrinter.h"

namespace tnctl {
namespace {

relay::Reply await(const GlobalOptions& options, const ClientOperation& operation, tn::TNDaemonClient& client) {
  tn::BlockingReply pending;
  operation(client, pending.block());
  return pending.wait(std::chrono::seconds(options.timeoutSeconds));
}

[[noreturn]] void failUnreachable(const GlobalOptions& options, const tn::Error& error) {
  if (tn::isTimedOut(error)) {
    fail(fmt::format("no reply from tenond at {} within {} seconds", options.service, options.timeoutSeconds));
  }
  fail(fmt::format("cannot reach tenond at {}: {}", options.service, error.localizedDescription()));
}

std::optional<tn::Error> errorIn(const relay::Reply& reply) {
  try {
    return tn::TNDaemonClient::errorInReply(reply);
  } catch (const tn::InternalInconsistency& violation) {
    fail(violation.what());
  }
}

}  // namespace

namespace {

void run(const GlobalOptions& options, const ClientOperation& operation, const ReadablePrinter& readable,
         const std::string& emptySuccess) {
  tn::TNDaemonClient client(options.service);
  const relay::Reply reply = await(options, operation, client);
  if (!reply) failUnreachable(options, reply.error());

  const std::optional<tn::Error> error = errorIn(reply);
  if (readable && !error && !options.json) {
    readable(client, *reply);
  } else {
    printReply(client, *reply, options.json, /*succeeded=*/!error, emptySuccess);
  }
  if (error) fail(fmt::format("error {}: {}", error->code(), error->localizedDescription()));
}

}  // namespace

void runClientOperation(const GlobalOptions& options, const ClientOperation& operation,
                        const std::string& emptySuccess) {
  run(options, operation, {}, emptySuccess);
}

void runClientOperationQuietly(const GlobalOptions& options, const ClientOperation& operation,
                               const ReadablePrinter& succeeded) {
  tn::TNDaemonClient client(options.service);
  const relay::Reply reply = await(options, operation, client);
  if (!reply) failUnreachable(options, reply.error());
  if (const std::optional<tn::Error> error = errorIn(reply)) {
    fail(fmt::format("error {}: {}", error->code(), error->localizedDescription()));
  }
  succeeded(client, *reply);
}

void runClientOperation(const GlobalOptions& options, const ClientOperation& operation,
                        const ReadablePrinter& readable) {
  run(options, operation, readable, "ok");
}

}  // namespace tnctl
