#pragma once

// The one place where tnctl talks to tenond: make a client for the chosen
// service, run one client operation, wait for its reply, print it, and turn
// failures into tnctl's error lines and exit status 1:
//
//   tnctl: cannot reach tenond at <socket path>: <reason>; is tenond running, and is TENON_ROOT set …?
//   tnctl: no reply from tenond at <socket path> within <n> seconds
//   tnctl: error <code>: <message>

#include <functional>
#include <optional>
#include <string>

#include "libtenon/client/TNDaemonClient.h"
#include "tools/tnctl/Command.h"

namespace tnctl {

// Starts one request: calls one operation of the client with the block.
using ClientOperation = std::function<void(tn::TNDaemonClient& client, tn::TNDaemonClient::ReplyBlock reply)>;

// Prints a successful reply for people (without --json), in place of the
// generic readable printing (ReplyPrinter.h).
using ReadablePrinter = std::function<void(const tn::TNDaemonClient& client, const tn::Value& reply)>;

// Runs `operation` against the daemon and reports its reply on stdout;
// fails the command when the daemon cannot be reached or reports an error.
// A success that carries nothing reads `emptySuccess` in the readable form.
void runClientOperation(const GlobalOptions& options, const ClientOperation& operation,
                        const std::string& emptySuccess = "ok");
// The same, with a success printed by `readable` for people.
void runClientOperation(const GlobalOptions& options, const ClientOperation& operation,
                        const ReadablePrinter& readable);

// More about a daemon's error, found by tnctl itself; none when it has
// nothing to add.
using FailureExplainer = std::function<std::optional<std::string>(const tn::Error& error)>;

// How a command shows its reply when the generic printing does not fit,
// and what it does while its connection is still open. Empty members keep
// the generic behaviour.
struct ReplyHandling {
  ReadablePrinter readable;         // a success, for people
  ReadablePrinter readableFailure;  // what a failure carried, for people (before the error line)
  std::string emptySuccess = "ok";  // a success that carries nothing, for people
  // Runs after a success has been printed and stdout flushed, before the
  // connection closes: what the daemon ties to the connection (a hold)
  // lasts until it returns.
  std::function<void(tn::TNDaemonClient& client)> whileConnected;
  // What the daemon's error reply cannot say: lines added to the error
  // ("tnctl: error 2: unable to register …" then why, found locally).
  FailureExplainer explainFailure;
};
void runClientOperation(const GlobalOptions& options, const ClientOperation& operation, const ReplyHandling& handling);

// Runs `operation` and hands a successful reply to `succeeded` without
// printing anything; fails the command as runClientOperation does.
void runClientOperationQuietly(const GlobalOptions& options, const ClientOperation& operation,
                               const ReadablePrinter& succeeded);

}  // namespace tnctl
