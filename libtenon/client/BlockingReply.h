#pragma once

// BlockingReply: waits on the calling thread for the one reply a
// TNDaemonClient operation hands to its reply block. For tools and tests,
// which have nothing else to do meanwhile:
//
//   tn::BlockingReply pending;
//   client.addPlugIns(paths, pending.block());
//   relay::Reply reply = pending.wait(std::chrono::seconds(30));
//
// wait() must not run on the client's reply queue: the reply block runs
// there and could never start. A reply that comes after the timeout is
// dropped; the block stays safe to call because it shares its state with
// the BlockingReply rather than referring to it.

#include <chrono>
#include <cstdint>
#include <memory>
#include <string_view>

#include "platform/relay/Event.h"
#include "platform/value/Error.h"

namespace tn {

// Errors of the waiting helpers (domain "TNDaemonClient").
inline constexpr std::string_view kDaemonClientErrorDomain = "TNDaemonClient";
enum class DaemonClientErrorCode : int64_t {
  TimedOut = 1,  // no reply within the time given to wait()
};

// True when error is the timeout of BlockingReply::wait.
bool isTimedOut(const Error& error);

class BlockingReply {
 public:
  BlockingReply();

  // The reply block to give to exactly one operation. Any thread.
  relay::ReplyHandler block() const;

  // The reply (a dictionary or a relay error), or a TimedOut error when none
  // came within `timeout`. Call once.
  relay::Reply wait(std::chrono::milliseconds timeout);

 private:
  struct State;
  std::shared_ptr<State> state_;
};

}  // namespace tn
