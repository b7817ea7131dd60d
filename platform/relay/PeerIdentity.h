// PeerIdentity: who the peer of a connection is, established once, when the
// connection is accepted, on the listener's queue.
//
//   - auditToken: pid, credentials, groups, start time and pidfd.
//   - executablePath: the path /proc/<pid>/exe links to, for logs and for
//     finding the peer's bundle. Empty when the link cannot be read (a
//     process of another user, for a daemon without the privilege to look
//     at it). A replaced executable reads as "<path> (deleted)", as the
//     kernel reports it. The path is what the PEER's mount namespace calls
//     the file, which may name another file in ours.
//   - executableDevice/executableInode: the file /proc/<pid>/exe opens to, the
//     very file the peer runs whatever its path; executableKnown is false
//     when it could not be opened (such a peer gets no entitlements).
//   - seccompFilters: the peer's seccomp filter count (/proc/<pid>/status),
//     none when it could not be read (sandbox::countsAsSandboxed() then
//     treats the peer as sandboxed).
// Everything is read while the token shows the process alive and is checked
// against the token afterwards, so nothing belongs to a process that took
// over the pid.

#pragma once

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string>

#include "platform/relay/AuditToken.h"
#include "platform/relay/UniqueFd.h"
#include "platform/value/Result.h"

namespace relay {

struct PeerIdentity {
  AuditToken auditToken;
  std::string executablePath;
  bool executableKnown = false;
  dev_t executableDevice = 0;
  ino_t executableInode = 0;
  std::optional<uint64_t> seccompFilters;

  // Identifies the peer of a connected Unix stream socket. Errors as
  // AuditToken::ofSocketPeer, and PeerUnidentified when the process changed
  // while it was examined.
  static tn::Result<PeerIdentity> ofSocketPeer(int socketFd);

  // Opens (O_PATH) the file the peer runs NOW, through /proc/<pid>/exe, and
  // checks that the pid still belongs to the process that connected and
  // that the file is the one it ran when it was accepted. Errors
  // (PeerUnidentified, with the reason): the executable was not known at
  // accept time, the process is gone, the file cannot be opened, or it is
  // another file (the peer called exec since).
  tn::Result<UniqueFd> openRunningExecutable() const;
};

}  // namespace relay
