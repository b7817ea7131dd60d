#include "platform/relay/IoThread.h"

#include <pthread.h>

#include <asio/executor_work_guard.hpp>
#include <thread>

namespace relay::detail {
namespace {

thread_local bool isIoThread = false;

struct IoThread {
  asio::io_context context{1};
  asio::executor_work_guard<asio::io_context::executor_type> keepRunning =
      asio::make_work_guard(context);

  IoThread() {
    std::thread thread([this] {
      isIoThread = true;
      ::pthread_setname_np(::pthread_self(), "relay-io");
      context.run();
    });
    thread.detach();
  }
};

}  // namespace

asio::io_context& ioContext() {
  // Never destroyed: connections may still post work while the process exits.
  static IoThread* const instance = new IoThread;
  return instance->context;
}

bool onIoThread() { return isIoThread; }

}  // namespace relay::detail
