#pragma once

// The scale benchmark's load client: `connections` sockets to one relay
// socket, each keeping `depth` requests in flight (a reply read, the next
// request sent at once), all driven by one thread with epoll, for a fixed
// time. The requests cycle through the given frames; each connection
// numbers its own. The same client runs against tenond and against the
// echo, so that requests per second are quoted against what the socket
// alone allows on the same machine in the same run.

#include <chrono>
#include <cstdint>
#include <functional>
#include <span>
#include <string>
#include <vector>

#include "platform/value/Value.h"

namespace tn::bench {

struct LoadOptions {
  int connections = 32;
  int depth = 16;
  std::chrono::milliseconds warmUp{500};
  std::chrono::milliseconds measured{3000};
  // Every `checkEvery`-th reply is given to `check` (none: not checked);
  // one that fails it fails the benchmark.
  std::function<bool(std::span<const uint8_t>)> check;
  int checkEvery = 1000;
};

struct LoadResult {
  uint64_t replies = 0;  // in the measured time
  double requestsPerSecond = 0;
};

LoadResult runLoad(const std::string& path, const std::vector<Bytes>& frames, const LoadOptions& options);

}  // namespace tn::bench
