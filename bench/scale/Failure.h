#pragma once

// How the scale benchmark gives up: every failure it can detect throws, so
// that the daemons it started are stopped and its private root is removed
// on the way out (an abort would leave both behind).

#include <atomic>
#include <stdexcept>
#include <string>

namespace tn::bench {

struct BenchFailure : std::runtime_error {
  using std::runtime_error::runtime_error;
};

[[noreturn]] inline void fail(const std::string& what) { throw BenchFailure(what); }

// Set by the benchmark's SIGINT and SIGTERM handler; its waits end early
// when it is set, so that an interrupted run still cleans up.
inline std::atomic<bool> interrupted{false};
inline void failIfInterrupted() {
  if (interrupted) fail("interrupted");
}

}  // namespace tn::bench
