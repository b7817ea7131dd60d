// AuditToken: who the process at the other end of a connection is.
//
// pid, uid and gid come from SO_PEERCRED (the credentials the peer had when
// it connected), its supplementary groups from SO_PEERGROUPS (also as of
// connect()). A pid alone can be reused once its process is gone, so the
// token also carries the process's start time (ProcessStartTime.h) and a
// pidfd, a handle on that very process which no other process can take
// over:
//   - SO_PEERPIDFD gives the pidfd of the connecting process itself, where
//     the kernel has it (Linux 6.5 and later); the pid it refers to is
//     checked against SO_PEERCRED.
//   - Older kernels: pidfd_open(pid) at once, with the start time read
//     before and after it, which must agree. The pid could in principle have
//     been reused between connect() and that moment; the window is the time
//     between the peer's exit and our accept, and a new process would have
//     to take the same pid within it.
// Either way the start time is read while the pidfd shows the process alive,
// so it belongs to the process the pidfd holds. A peer that has already
// exited when it is identified is refused (PeerUnidentified): nothing it
// sent could be attributed to it.
//
// Copies share the pidfd. Threads: any; a token is immutable once made.

#pragma once

#include <sys/types.h>

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "platform/relay/UniqueFd.h"
#include "platform/value/Result.h"

namespace relay {

struct AuditToken {
  enum class PidfdSource { None, PeerSocket, OpenedByPid };

  pid_t pid = 0;
  uid_t uid = 0;
  gid_t gid = 0;
  // Supplementary groups (SO_PEERGROUPS), in the kernel's order; empty when
  // the peer has none or the kernel does not report them.
  std::vector<gid_t> groups;
  uint64_t startTime = 0;  // clock ticks since boot, /proc/<pid>/stat field 22
  // Null only when the kernel has no pidfds at all.
  std::shared_ptr<const UniqueFd> pidfd;
  PidfdSource pidfdSource = PidfdSource::None;

  // The identity of the peer of a connected Unix stream socket, established
  // now (see above). Errors: SystemError when the socket has no peer
  // credentials, PeerUnidentified when the peer is gone or the checks
  // disagree.
  static tn::Result<AuditToken> ofSocketPeer(int socketFd);

  // True when gid is the primary group or one of the supplementary groups.
  bool isMemberOf(gid_t group) const;

  // True while the process this token names is still running: its pidfd
  // does not report an exit and /proc/<pid> shows the same start time. A
  // process that has exited but was not yet reaped counts as gone.
  bool stillSameProcess() const;

  // "pid=12 uid=1000 gid=1000 start=4711", for logs.
  std::string description() const;

  // Same process and credentials (the pidfd is not compared).
  friend bool operator==(const AuditToken& a, const AuditToken& b) {
    return a.pid == b.pid && a.uid == b.uid && a.gid == b.gid && a.startTime == b.startTime;
  }
};

}  // namespace relay
