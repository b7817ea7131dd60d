#pragma once

// The one place where tnctl talks to tenond: make a client for the chosen
// service, run one client operation, wait for its reply, print it, and turn
// failures into tnctl's error lines and exit status 1:
//
//   tnctl: cannot reach tenond at <service>: <reason>
//   tnctl: no reply from tenond at <service> within <n> seconds
//   tnctl: error <code>: <message>

#include <functional>

#include "libtenon/client/TNDaemonClient.h"
#include "tools/tnctl/Command.h"

namespace tnctl {

// Starts one request: calls one operation of the client with the block.
using ClientOperation = std::function<void(tn::TNDaemonClient& client, tn::TNDaemonClient::ReplyBlock reply)>;

// Runs `operation` against the daemon and reports its reply on stdout;
// fails the command when the daemon cannot be reached or reports an error.
void runClientOperation(const GlobalOptions& options, const ClientOperation& operation);

}  // namespace tnctl
