// PeerIdentity: the audit token of a connection's peer and the path of its
// executable, both established once, when the connection is made.
//
// The executable path is read from /proc/<pid>/exe and then checked against
// the token (the process must still be the same one), so it cannot belong to
// a process that took over the pid. It is empty when the link cannot be read
// (a process of another user, for a daemon without the privilege to look at
// it). A replaced executable reads as "<path> (deleted)", as the kernel
// reports it.

#pragma once

#include <string>

#include "platform/relay/AuditToken.h"
#include "platform/value/Result.h"

namespace relay {

struct PeerIdentity {
  AuditToken auditToken;
  std::string executablePath;

  // Identifies the peer of a connected Unix stream socket. Errors as
  // AuditToken::ofSocketPeer, and PeerUnidentified when the process changed
  // while its executable was read.
  static tn::Result<PeerIdentity> ofSocketPeer(int socketFd);
};

}  // namespace relay
