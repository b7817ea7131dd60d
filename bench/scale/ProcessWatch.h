#pragma once

// A process of the benchmark: tenond (or a launcher that becomes it)
// started as a child that dies with the benchmark (so that a benchmark
// killed outright leaves no daemon behind), stopped with SIGTERM when the
// object goes; and what /proc says about any process: resident memory, CPU
// ticks, and how often each of its threads was woken.

#include <sys/types.h>

#include <cstdint>
#include <map>
#include <string>
#include <vector>

namespace tn::bench {

class ChildDaemon {
 public:
  // Starts `argv` (argv[0] a path) with stderr on /dev/null.
  explicit ChildDaemon(const std::vector<std::string>& argv);
  ~ChildDaemon();
  ChildDaemon(const ChildDaemon&) = delete;
  ChildDaemon& operator=(const ChildDaemon&) = delete;

  pid_t pid() const { return pid_; }
  // SIGTERM, then waits for the exit (at most 10 s, then SIGKILL).
  void stop();

 private:
  pid_t pid_ = -1;
};

// VmRSS of `pid` in bytes.
uint64_t residentBytes(pid_t pid);

// utime + stime of `pid` (every thread), in clock ticks.
uint64_t cpuTicks(pid_t pid);

// The threads of `pid` (/proc/PID/task).
std::vector<pid_t> threadsOf(pid_t pid);

// Per thread ("tid name"), voluntary plus involuntary context switches: a
// thread asleep on an event that never comes adds nothing.
std::map<std::string, uint64_t> threadSwitches(pid_t pid);

// The threads of `later` whose count grew since `earlier`, with the growth.
std::map<std::string, uint64_t> wokenThreads(const std::map<std::string, uint64_t>& earlier,
                                             const std::map<std::string, uint64_t>& later);

}  // namespace tn::bench
