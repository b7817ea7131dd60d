#pragma once

// Test support for the client tests: a private TENON_ROOT and a fake tenond
// made with relay::Listener, which records every request it receives and
// answers it with what the test's responder says. Waits give up after 20
// seconds so that a broken build fails instead of hanging.

#include <chrono>
#include <condition_variable>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "tests/support/TempDirectory.h"
#include "platform/dispatch/SerialQueue.h"
#include "platform/relay/Connection.h"
#include "platform/relay/Listener.h"
#include "platform/value/Value.h"

namespace tn::test {

inline constexpr std::chrono::seconds kPatience{20};

class FakeDaemon {
 public:
  // The reply to a request; a null value sends none.
  using Responder = std::function<Value(const Value& request)>;

  // Listens on `serviceName` under the current TENON_ROOT; answers every
  // request with an empty dictionary unless told otherwise.
  explicit FakeDaemon(std::string serviceName, Responder respond = nullptr);
  ~FakeDaemon();  // cancels the listener and every connection

  // Waits until at least `count` requests arrived; returns them all, in
  // arrival order.
  std::vector<Value> waitForRequests(size_t count);

  // Cancels every accepted connection (the client sees its service go).
  void dropConnections();

 private:
  // What the connections' event handlers share with the test; kept alive by
  // them, so a late event never meets a destroyed FakeDaemon.
  struct Requests {
    Responder respond;
    std::mutex mutex;
    std::condition_variable arrived;
    std::vector<Value> received;  // guarded by mutex
  };

  void accept(std::shared_ptr<relay::Connection> connection);

  const std::shared_ptr<Requests> requests_ = std::make_shared<Requests>();
  std::shared_ptr<dispatch::SerialQueue> queue_ = dispatch::SerialQueue::create("fake-tenond");
  std::shared_ptr<relay::Listener> listener_;
  std::mutex mutex_;
  std::vector<std::shared_ptr<relay::Connection>> connections_;  // guarded by mutex_
};

// Runs `condition` until it holds; false after kPatience.
bool eventually(const std::function<bool()>& condition);

}  // namespace tn::test
