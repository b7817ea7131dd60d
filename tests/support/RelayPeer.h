#pragma once

// RelayPeer: this test process as one client of a relay service: one
// connection, requests sent one at a time, each waiting for its reply.
//
//   RelayPeer peer(daemon.service());      // TENON_ROOT must name the daemon's root
//   Value reply = peer.request({{"request", "find"}, {"version", 3}});
//
// The connection is cancelled when the peer goes.

#include <chrono>
#include <memory>
#include <string>

#include "platform/dispatch/Semaphore.h"
#include "platform/dispatch/SerialQueue.h"
#include "platform/relay/Connection.h"
#include "platform/value/Value.h"

namespace tn::test {

class RelayPeer {
 public:
  explicit RelayPeer(const std::string& service) : queue_(dispatch::SerialQueue::create("test-peer")) {
    auto connected = relay::Connection::connectToService(service, queue_);
    if (!connected) return;
    connection_ = *connected;
    connection_->setEventHandler([](const relay::Event&) {});
    connection_->resume();
  }
  ~RelayPeer() {
    if (connection_) connection_->cancel();
  }
  RelayPeer(const RelayPeer&) = delete;
  RelayPeer& operator=(const RelayPeer&) = delete;

  bool connected() const { return connection_ != nullptr; }

  // The reply dictionary, or null when none came within `patience`.
  Value request(Dictionary body, std::chrono::milliseconds patience = std::chrono::seconds(10)) {
    dispatch::Semaphore replied;
    Value reply;
    connection_->sendWithReply(Value(std::move(body)), queue_, [&](relay::Reply received) {
      if (received) reply = *received;
      replied.signal();
    });
    if (!replied.waitFor(patience)) return Value();
    return reply;
  }

  const std::shared_ptr<relay::Connection>& connection() const { return connection_; }

 private:
  std::shared_ptr<dispatch::SerialQueue> queue_;
  std::shared_ptr<relay::Connection> connection_;
};

}  // namespace tn::test
