#include "libtenon/client/BlockingReply.h"

#include <mutex>
#include <optional>
#include <utility>

#include <fmt/format.h>

#include "platform/dispatch/Semaphore.h"

namespace tn {

struct BlockingReply::State {
  dispatch::Semaphore arrived;
  std::mutex mutex;
  std::optional<relay::Reply> reply;  // guarded by mutex
};

bool isTimedOut(const Error& error) {
  return error.domain() == kDaemonClientErrorDomain &&
         error.code() == static_cast<int64_t>(DaemonClientErrorCode::TimedOut);
}

BlockingReply::BlockingReply() : state_(std::make_shared<State>()) {}

relay::ReplyHandler BlockingReply::block() const {
  return [state = state_](relay::Reply reply) {
    {
      const std::lock_guard lock(state->mutex);
      state->reply = std::move(reply);
    }
    state->arrived.signal();
  };
}

relay::Reply BlockingReply::wait(std::chrono::milliseconds timeout) {
  if (!state_->arrived.waitFor(timeout)) {
    return Error(std::string(kDaemonClientErrorDomain), static_cast<int64_t>(DaemonClientErrorCode::TimedOut),
                 fmt::format("no reply from tenond within {} ms", timeout.count()));
  }
  const std::lock_guard lock(state_->mutex);
  return std::move(*state_->reply);
}

}  // namespace tn
