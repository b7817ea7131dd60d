#pragma once

// Where the benchmark's processes run. On a virtual machine a process woken
// on another processor than its waker's pays for the wake-up of that
// processor (tens of microseconds here), one woken on its waker's processor
// does not; the scheduler makes that choice per process, so two servers
// timed unpinned side by side may be timed on different terms (the echo
// woken beside its client, the daemon across). A sequential round trip is
// therefore compared with the echo's under the same placement: every
// process on one processor, and the servers on another processor than
// their client.

#include <sched.h>
#include <sys/types.h>

#include <string>
#include <utility>
#include <vector>

namespace tn::bench {

// The processors this process may run on, lowest first.
std::vector<int> usableProcessors();

// While it lives, the calling thread runs on `clientProcessor` and every
// thread of each of `servers` on `serverProcessor`; then every affinity it
// changed is what it was. Threads a server starts meanwhile inherit the
// placement of their creator, and get their process's first affinity back.
class ScopedPlacement {
 public:
  ScopedPlacement(int clientProcessor, int serverProcessor, const std::vector<pid_t>& servers);
  ~ScopedPlacement();
  ScopedPlacement(const ScopedPlacement&) = delete;
  ScopedPlacement& operator=(const ScopedPlacement&) = delete;

 private:
  cpu_set_t client_;
  std::vector<std::pair<pid_t, cpu_set_t>> servers_;  // each process and its affinity before
};

}  // namespace tn::bench
