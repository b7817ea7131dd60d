// Spawner: starts a plug-in's executable in a process of its own.
//
// Everything the child needs is prepared here, in the supervisor, before
// the fork: the argument and environment arrays, the descriptors it keeps,
// the Landlock ruleset and the seccomp program. The child of a
// multithreaded process may only make async-signal-safe calls, so it
// allocates nothing and calls the kernel directly; in order it:
//   1. unblocks every signal and resets every handler (tenond blocks SIGTERM
//      in all its threads, and a mask survives exec);
//   2. starts a session of its own (setsid);
//   3. becomes the host's user: supplementary groups, gid, uid, when the
//      supervisor runs as root (otherwise the user must be its own, which
//      the caller checks);
//   4. sets no_new_privs, enforces the Landlock ruleset;
//   5. puts /dev/null on 0, 1 and 2 and the plug-in's socket on 3, and
//      closes every other descriptor;
//   6. installs the seccomp program, last, so that nothing above is denied;
//   7. execs the executable with exactly the prepared environment.
// A failure in the child is reported through a close-on-exec pipe (which
// step, which errno) and the child exits with status 127; the parent reads
// the pipe until exec closes it, so start() knows whether the exec worked.

#pragma once

#include <linux/filter.h>
#include <sys/types.h>

#include <string>
#include <vector>

#include "platform/relay/UniqueFd.h"
#include "platform/value/Result.h"
#include "platform/warden/ProcessHandle.h"

namespace warden {

// The descriptor number the plug-in finds its socket on.
inline constexpr int kPluginSocketDescriptor = 3;

struct SpawnPlan {
  std::string executable;
  std::vector<std::string> arguments;    // argv, the first being the name
  std::vector<std::string> environment;  // "NAME=value" entries, exactly these
  bool changeUser = false;               // only when the supervisor runs as root
  Credentials user;
  relay::UniqueFd socket;                 // the plug-in's end; becomes descriptor 3
  relay::UniqueFd landlockRuleset;        // invalid: none
  std::vector<sock_filter> seccompProgram;  // empty: none
};

// Starts the plan's process. Errors (domain "warden"): the system call that
// failed in the parent, or the step that failed in the child, with errno.
tn::Result<ProcessHandle> spawn(SpawnPlan& plan);

}  // namespace warden
