#include "tools/tnctl/DaemonSession.h"

#include <chrono>
#include <cstdio>
#include <functional>
#include <optional>

#include <fmt/format.h>

#include "libtenon/client/BlockingReply.h"
#include "libtenon/client/InternalInconsistency.h"
#include "platform/paths/InstancePaths.h"
#include "platform/relay/ServicePath.h"
#include "tools/tnctl/ReplyPrinter.h"

namespace tnctl {
namespace {

relay::Reply await(const GlobalOptions& options, const ClientOperation& operation, tn::TNDaemonClient& client) {
  tn::BlockingReply pending;
  operation(client, pending.block());
  return pending.wait(std::chrono::seconds(options.timeoutSeconds));
}

// Where the daemon's socket is, as this process sees it: the path tells a
// person which root and which instance tnctl looked for.
std::string socketPath(const GlobalOptions& options) {
  tn::Result<std::string> path = relay::servicePath(options.service);
  return path ? *path : fmt::format("(no socket path: {})", path.error().localizedDescription());
}

std::string likelyCauses() {
  const std::string root = paths::platformRoot();
  const std::string rootNow = !root.empty() ? fmt::format("it is \"{}\"", root) : std::string("it is not set");
  const bool user = paths::currentLayout().instance == paths::Instance::User;
  return fmt::format("is tenond running{}, and is TENON_ROOT set to the root it serves ({})?",
                     user ? " as your per-user instance (TENON_INSTANCE=user; systemctl --user start tenond.socket)"
                          : "",
                     rootNow);
}

[[noreturn]] void failUnreachable(const GlobalOptions& options, const tn::Error& error) {
  const std::string socket = socketPath(options);
  const tn::Dictionary details{{"service", options.service}, {"socket", socket}};
  if (tn::isTimedOut(error)) {
    fail(fmt::format("no reply from tenond at {} within {} seconds", socket, options.timeoutSeconds), details);
  }
  // The relay's reason names the socket most of the time: the path is said once.
  const std::string reason = error.localizedDescription();
  const std::string where = reason.find(socket) == std::string::npos ? " at " + socket : std::string();
  fail(fmt::format("cannot reach tenond{}: {}; {}", where, reason, likelyCauses()), details);
}

std::optional<tn::Error> errorIn(const relay::Reply& reply) {
  try {
    return tn::TNDaemonClient::errorInReply(reply);
  } catch (const tn::InternalInconsistency& violation) {
    fail(violation.what());
  }
}

// Connects, sends the request, waits for its reply and hands it, with the
// client (whose connection is still open), to `handle`; fails the command
// when the daemon cannot be reached or does not answer in time.
void withReply(const GlobalOptions& options, const ClientOperation& operation,
               const std::function<void(tn::TNDaemonClient&, const relay::Reply& reply)>& handle) {
  tn::TNDaemonClient client(options.service);
  const relay::Reply reply = await(options, operation, client);
  if (!reply) failUnreachable(options, reply.error());
  handle(client, reply);
}

[[noreturn]] void failWith(const tn::Error& error, const FailureExplainer& explain = {}) {
  std::string message = fmt::format("error {}: {}", error.code(), error.localizedDescription());
  if (explain) {
    if (std::optional<std::string> why = explain(error)) message += "\n" + *why;
  }
  fail(message, tn::Dictionary{{"errorcode", error.code()}});
}

}  // namespace

void runClientOperation(const GlobalOptions& options, const ClientOperation& operation, const ReplyHandling& handling) {
  withReply(options, operation, [&](tn::TNDaemonClient& client, const relay::Reply& reply) {
    const std::optional<tn::Error> error = errorIn(reply);
    const ReadablePrinter& readable = error ? handling.readableFailure : handling.readable;
    if (readable && !options.json) {
      readable(client, *reply);
      std::fflush(stdout);
    } else {
      printReply(client, *reply, options.json, /*succeeded=*/!error, handling.emptySuccess);
    }
    if (error) failWith(*error, handling.explainFailure);
    if (handling.whileConnected) handling.whileConnected(client);
  });
}

void runClientOperation(const GlobalOptions& options, const ClientOperation& operation,
                        const std::string& emptySuccess) {
  ReplyHandling handling;
  handling.emptySuccess = emptySuccess;
  runClientOperation(options, operation, handling);
}

void runClientOperation(const GlobalOptions& options, const ClientOperation& operation,
                        const ReadablePrinter& readable) {
  ReplyHandling handling;
  handling.readable = readable;
  runClientOperation(options, operation, handling);
}

void runClientOperationQuietly(const GlobalOptions& options, const ClientOperation& operation,
                               const ReadablePrinter& succeeded) {
  withReply(options, operation, [&](tn::TNDaemonClient& client, const relay::Reply& reply) {
    if (const std::optional<tn::Error> error = errorIn(reply)) failWith(*error);
    succeeded(client, *reply);
  });
}

}  // namespace tnctl
