// ProcessHandle: one process, held by a pidfd and told apart from any later
// process with the same pid by its start time.
//
// Made from a pid (pidfd_open, with the start time read before and after,
// which must agree) or from a connection's audit token (whose pidfd and
// start time the relay established). Its credentials are read from
// /proc/<pid>/status while the pidfd shows the process alive and checked
// against the start time afterwards, so they never belong to a process that
// took over the pid.
//
// Copies share the pidfd. Threads: any; a handle is immutable.

#pragma once

#include <sys/types.h>

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "platform/relay/AuditToken.h"
#include "platform/relay/UniqueFd.h"
#include "platform/value/Result.h"

namespace warden {

// Who a process runs as: the effective ids and the supplementary groups.
struct Credentials {
  uid_t uid = 0;
  gid_t gid = 0;
  std::vector<gid_t> groups;
};

// The Uid/Gid/Groups lines of a /proc/<pid>/status text (effective ids:
// the second number of Uid and Gid). None when a line is missing or
// malformed.
std::optional<Credentials> parseStatusCredentials(std::string_view status);

class ProcessHandle {
 public:
  // The process that has `pid` now. Errors (domain "warden", ESRCH and
  // friends as codes): no such process, or it changed hands while it was
  // opened.
  static tn::Result<ProcessHandle> open(pid_t pid);

  // The process of an audit token; its pidfd must be set.
  static tn::Result<ProcessHandle> fromToken(const relay::AuditToken& token);

  // Takes over `pidfd` of a child this process just started.
  static tn::Result<ProcessHandle> adoptChild(pid_t pid, relay::UniqueFd pidfd);

  pid_t pid() const { return pid_; }
  uint64_t startTime() const { return startTime_; }
  int pidfd() const { return pidfd_->get(); }

  // True while the process runs (its pidfd reports no exit).
  bool alive() const;

  // Its credentials now, read as described above. Errors: the process is
  // gone, or its status cannot be read.
  tn::Result<Credentials> credentials() const;

  // Sends `signal` through the pidfd; false when the process is gone.
  bool signal(int signal) const;

  // Same process (pid and start time).
  bool sameProcess(pid_t pid, uint64_t startTime) const { return pid_ == pid && startTime_ == startTime; }

 private:
  ProcessHandle(pid_t pid, uint64_t startTime, std::shared_ptr<const relay::UniqueFd> pidfd)
      : pid_(pid), startTime_(startTime), pidfd_(std::move(pidfd)) {}

  pid_t pid_;
  uint64_t startTime_;
  std::shared_ptr<const relay::UniqueFd> pidfd_;
};

}  // namespace warden
