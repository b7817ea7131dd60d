#include "platform/relay/IoContext.h"

#include <asio/executor_work_guard.hpp>
#include <asio/post.hpp>

#include "platform/dispatch/Poller.h"
#include "platform/dispatch/ThreadPool.h"

namespace relay::detail {
namespace {

class IoPoller final : public tn::dispatch::Poller {
 public:
  IoPoller() { tn::dispatch::ThreadPool::shared().setPoller(this); }

  void pollOnce() override { context.run_one(); }

  // A no-op handler wakes the waiting run_one(), which runs it and returns.
  // When nobody waits, the next pollOnce() returns at once instead: harmless.
  void interrupt() override {
    asio::post(context, [] {});
  }

  asio::io_context context;
  // run_one() would return at once, forever, on an io_context without work.
  asio::executor_work_guard<asio::io_context::executor_type> keepRunning = asio::make_work_guard(context);
};

}  // namespace

asio::io_context& ioContext() {
  // Never destroyed: connections may still post work while the process exits.
  static IoPoller* const instance = new IoPoller;
  return instance->context;
}

}  // namespace relay::detail
