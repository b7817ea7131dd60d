#include "tests/libtenon/client/FakeDaemon.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>
#include <thread>

namespace tn::test {

FakeDaemon::FakeDaemon(std::string serviceName, Responder respond) {
  requests_->respond = respond ? std::move(respond) : [](const Value&) { return Value(Dictionary()); };
  auto listener = relay::Listener::create(std::move(serviceName), queue_);
  if (!listener) {
    ADD_FAILURE() << listener.error().description();
    return;
  }
  listener_ = *listener;
  listener_->setNewConnectionHandler([this](std::shared_ptr<relay::Connection> connection) { accept(connection); });
  listener_->resume();
}

FakeDaemon::~FakeDaemon() {
  if (listener_) listener_->cancel();
  queue_->sync([] {});  // no connection is admitted after this
  dropConnections();
}

void FakeDaemon::accept(std::shared_ptr<relay::Connection> connection) {
  connection->setEventHandler([requests = requests_, weak = std::weak_ptr(connection)](const relay::Event& event) {
    if (event.kind != relay::Event::Kind::Message) return;
    {
      const std::lock_guard lock(requests->mutex);
      requests->received.push_back(event.message.body);
      requests->arrived.notify_all();
    }
    const Value reply = requests->respond(event.message.body);
    if (auto self = weak.lock(); self && !reply.isNull()) self->sendReply(event.message, reply);
  });
  connection->resume();
  const std::lock_guard lock(mutex_);
  connections_.push_back(std::move(connection));
}

std::vector<Value> FakeDaemon::waitForRequests(size_t count) {
  std::unique_lock lock(requests_->mutex);
  const auto& received = requests_->received;
  if (!requests_->arrived.wait_for(lock, kPatience, [&] { return received.size() >= count; })) {
    ADD_FAILURE() << "waited for " << count << " requests, got " << received.size();
  }
  return received;
}

void FakeDaemon::dropConnections() {
  std::vector<std::shared_ptr<relay::Connection>> connections;
  {
    const std::lock_guard lock(mutex_);
    connections.swap(connections_);
  }
  for (const auto& connection : connections) connection->cancel();
}

bool eventually(const std::function<bool()>& condition) {
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  while (!condition()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  return true;
}

}  // namespace tn::test
