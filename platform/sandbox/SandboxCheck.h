#pragma once

// platform/sandbox: sandboxing of processes (library tn_sandbox).
//
// This folder stands in for the platform's sandbox service: whether a process
// is sandboxed (this file), and the extension tokens that open files and
// services to a sandboxed process (beside it).
//
// A process counts as sandboxed when it runs under more seccomp filters than
// the process asking: its "Seccomp_filters:" count in /proc/<pid>/status
// exceeds our own. Comparing with our own count rather than with zero keeps
// the answer right for a daemon inside a container, where every process
// inherits the container's filters. On kernels older than 5.9, whose status
// has no Seccomp_filters line, a process in filter mode ("Seccomp: 2")
// counts as running under one filter.
//
// Two ways to ask:
//   - For a connected peer, the daemon reads the peer's count once, when the
//     connection is accepted (the relay's PeerIdentity), and asks
//     countsAsSandboxed(). That answer fails closed: a count that could not
//     be read, or an own count that cannot be read, means "sandboxed", the
//     safer answer, since a sandboxed peer gets less.
//   - isProcessSandboxed() looks at a pid now. It answers "not sandboxed"
//     for a process that is gone or unreadable, which is right for callers
//     that only want to know whether a live process they know of runs
//     confined; it is not for judging a connection.

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string_view>

namespace sandbox {

// The answer for a peer whose filter count was read as peerFilters (none:
// it could not be read): true when peerFilters is none, when our own count
// cannot be read, or when peerFilters exceeds our own count (read now, so a
// filter the daemon added since is taken into account).
bool countsAsSandboxed(std::optional<uint64_t> peerFilters);

// True when the process pid is sandboxed (see above). False when it does not
// exist (any more) or its status cannot be read.
bool isProcessSandboxed(pid_t pid);

// The same for the process that had pid and started at startTime (clock
// ticks after boot, /proc/<pid>/stat field 22, as captured when it
// connected): false when pid now belongs to another process, so a recycled
// pid is never judged in place of the process that connected.
bool isProcessSandboxed(pid_t pid, uint64_t startTime);

// The number of seccomp filters process pid runs under; none when its status
// cannot be read.
std::optional<uint64_t> seccompFilterCount(pid_t pid);

// The start time of process pid (field 22 of /proc/<pid>/stat); none when it
// cannot be read.
std::optional<uint64_t> processStartTime(pid_t pid);

// The parsers behind the two above, for the text of /proc/<pid>/status and
// /proc/<pid>/stat. The command name in stat is read up to its last ')',
// since it may itself hold spaces and parentheses.
std::optional<uint64_t> parseSeccompFilterCount(std::string_view status);
std::optional<uint64_t> parseStartTime(std::string_view stat);

}  // namespace sandbox
