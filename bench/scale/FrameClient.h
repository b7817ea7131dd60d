#pragma once

// The leanest client of a relay socket, for the scale benchmark: a plain
// blocking Unix socket that writes whole frames and reads whole frames (the
// length in the first four bytes), as a client in any language would. The
// same client talks to tenond and to the echo, so that the two differ only
// in who answers.

#include <chrono>
#include <cstdint>
#include <functional>
#include <span>
#include <string>
#include <vector>

#include "platform/value/Value.h"

namespace tn::bench {

class FrameClient {
 public:
  // Connects to the socket at `path`; connected() tells whether it worked.
  explicit FrameClient(const std::string& path);
  ~FrameClient();
  FrameClient(const FrameClient&) = delete;
  FrameClient& operator=(const FrameClient&) = delete;

  bool connected() const { return fd_ >= 0; }

  // Sends `frame` with the next request id, then reads the next frame whole
  // into `reply`, waiting at most `patience` for each read (none: as long as
  // it takes, with plain blocking reads). False when either failed.
  bool roundTrip(Bytes& frame, Bytes& reply,
                 std::chrono::milliseconds patience = std::chrono::milliseconds::max());

 private:
  bool readAll(uint8_t* out, std::size_t size, std::chrono::milliseconds patience);

  int fd_ = -1;
  uint64_t lastId_ = 0;
};

// The frame of a "find" of one plug-in: by UUID, or by the file URL of its
// bundle.
Bytes findByUUIDFrame(const UUID& uuid);
Bytes findByPathFrame(const std::string& bundlePath);

// The reply frame's body when it is a successful "find" (a "matches" and no
// "errorcode"); otherwise none, and `why` says what it was.
bool isFoundReply(std::span<const uint8_t> frame, std::string* why = nullptr);

// Median and 99th percentile of a set of durations, in microseconds.
struct Percentiles {
  double median = 0;
  double p99 = 0;
};
Percentiles percentiles(std::vector<double> micros);

// `count` round trips over one connection to `path`, cycling through
// `frames` from `first` on, each timed from its send to its whole reply; every reply is
// checked with `check` after its time is taken (none: not checked). Fails
// the benchmark on any error.
std::vector<double> timeRoundTrips(const std::string& path, std::vector<Bytes> frames, std::size_t first,
                                   std::size_t count,
                                   const std::function<bool(std::span<const uint8_t>)>& check);

}  // namespace tn::bench
