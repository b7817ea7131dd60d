#pragma once

// The daemon's client object (TNDRelayClient) for a connection from this
// test process to itself, for tests that drive a real TNDServer in-process
// and make transactions straight from request dictionaries.

#include <future>
#include <memory>
#include <string>

#include <gtest/gtest.h>

#include "platform/dispatch/SerialQueue.h"
#include "platform/relay/Connection.h"
#include "platform/relay/Listener.h"
#include "tenond/server/TNDRelayClient.h"
#include "tenond/server/TNDServer.h"

namespace tnd::test {

struct InProcessClient {
  std::shared_ptr<relay::Connection> peer;  // this process's end; keep it
  std::shared_ptr<TNDRelayClient> client;   // the daemon's object for it
};

inline InProcessClient connectInProcessClient(const std::shared_ptr<TNDServer>& server, const std::string& service) {
  auto listener = relay::Listener::create(service, tn::dispatch::SerialQueue::create("pair"));
  EXPECT_TRUE(listener);
  std::promise<std::shared_ptr<TNDRelayClient>> made;
  (*listener)->setNewConnectionHandler([&](std::shared_ptr<relay::Connection> c) {
    made.set_value(TNDRelayClient::initWithConnection(std::move(c), server));
  });
  (*listener)->resume();
  auto peer = relay::Connection::connectToService(service, tn::dispatch::SerialQueue::create("peer"));
  EXPECT_TRUE(peer);
  (*peer)->setEventHandler([](const relay::Event&) {});
  (*peer)->resume();
  InProcessClient connected{*peer, made.get_future().get()};
  (*listener)->cancel();
  return connected;
}

}  // namespace tnd::test
