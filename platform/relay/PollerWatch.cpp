#include "platform/relay/PollerWatch.h"

#include <fcntl.h>

#include <asio/post.hpp>
#include <asio/posix/stream_descriptor.hpp>
#include <asio/steady_timer.hpp>
#include <optional>

#include "platform/relay/IoContext.h"

namespace relay {

// What the I/O thread works with. The asio objects are touched only there.
struct PollerWatch::State : std::enable_shared_from_this<PollerWatch::State> {
  std::shared_ptr<tn::dispatch::SerialQueue> queue;
  Block block;
  std::atomic<bool> done{false};  // fired or cancelled: whoever sets it first wins
  std::optional<asio::posix::stream_descriptor> descriptor;  // I/O thread
  std::optional<asio::steady_timer> timer;                    // I/O thread

  void fire() {
    if (done.exchange(true)) return;
    queue->async([self = shared_from_this()] {
      Block run = std::move(self->block);
      if (run) run();
    });
  }

  // I/O thread.
  void stop() {
    asio::error_code ignored;
    if (descriptor) descriptor->close(ignored);
    if (timer) timer->cancel();
  }
};

std::shared_ptr<PollerWatch> PollerWatch::whenReadable(int fd, std::shared_ptr<tn::dispatch::SerialQueue> queue,
                                                       Block block) {
  const int copy = ::fcntl(fd, F_DUPFD_CLOEXEC, 0);
  if (copy < 0) return nullptr;
  auto state = std::make_shared<State>();
  state->queue = std::move(queue);
  state->block = std::move(block);
  asio::post(detail::ioContext(), [state, copy] {
    state->descriptor.emplace(detail::ioContext(), copy);  // owns the copy from here on
    if (state->done) return state->stop();
    state->descriptor->async_wait(asio::posix::descriptor_base::wait_read,
                                  [state](const asio::error_code& error) {
                                    if (!error) state->fire();
                                    state->stop();
                                  });
  });
  return std::shared_ptr<PollerWatch>(new PollerWatch(std::move(state)));
}

std::shared_ptr<PollerWatch> PollerWatch::after(std::chrono::milliseconds delay,
                                                std::shared_ptr<tn::dispatch::SerialQueue> queue, Block block) {
  auto state = std::make_shared<State>();
  state->queue = std::move(queue);
  state->block = std::move(block);
  asio::post(detail::ioContext(), [state, delay] {
    if (state->done) return;
    state->timer.emplace(detail::ioContext(), delay);
    state->timer->async_wait([state](const asio::error_code& error) {
      if (!error) state->fire();
    });
  });
  return std::shared_ptr<PollerWatch>(new PollerWatch(std::move(state)));
}

PollerWatch::~PollerWatch() { cancel(); }

void PollerWatch::cancel() {
  if (state_->done.exchange(true)) return;
  state_->block = nullptr;
  asio::post(detail::ioContext(), [state = state_] { state->stop(); });
}

}  // namespace relay
