#include "libtenon/client/TNDaemonClient.h"

#include <utility>

#include <fmt/format.h>

#include "libtenon/client/BlockingReply.h"
#include "platform/dispatch/Fatal.h"
#include "platform/log/Log.h"
#include "platform/value/MessageValue.h"

namespace tn {
namespace {

std::string describe(const relay::Event& event) {
  switch (event.kind) {
    case relay::Event::Kind::Message:
      return fmt::format("unexpected message {}", event.message.body);
    case relay::Event::Kind::ConnectionInterrupted:
      return fmt::format("connection interrupted: {}", event.reason);
    case relay::Event::Kind::ConnectionInvalid:
      return fmt::format("connection invalid: {}", event.reason);
    case relay::Event::Kind::TerminationImminent:
      return "termination imminent";
  }
  return "unknown event";
}

std::string describe(const relay::Reply& reply) {
  return reply ? reply->description() : reply.error().description();
}

}  // namespace

// The connection's event handler: every event is reported and a broken
// connection told to the lost handler; nothing else happens (replies go to
// their blocks, and the relay reconnects by itself after an interruption).
// The event that the client's own cancel causes at release is not a
// communications error and stays quiet.
relay::Connection::EventHandler TNDaemonClient::eventHandler(std::shared_ptr<ConnectionWatch> watch) {
  return [watch = std::move(watch)](const relay::Event& event) {
    if (watch->releasing.load()) return;
    TN_LOG_ERROR(log::ops(), "Communications error: {}", describe(event));
    if (event.kind != relay::Event::Kind::ConnectionInterrupted && event.kind != relay::Event::Kind::ConnectionInvalid)
      return;
    std::function<void()> lost;
    {
      const std::lock_guard lock(watch->mutex);
      lost = watch->lost;
    }
    if (lost) lost();
  };
}

void TNDaemonClient::setConnectionLostHandler(std::function<void()> lost) {
  const std::lock_guard lock(watch_->mutex);
  watch_->lost = std::move(lost);
}

TNDaemonClient::TNDaemonClient(std::optional<std::string> serviceName)
    : serviceName_(serviceName ? std::move(*serviceName) : std::string(kDefaultServiceName)),
      replyQueue_(dispatch::SerialQueue::create(std::string(kReplyQueueLabel))) {
  const std::lock_guard lock(mutex_);
  // A daemon that is not there yet is tried again at the first send.
  (void)connectLocked();
}

TNDaemonClient::~TNDaemonClient() {
  watch_->releasing.store(true);
  if (auto connection = tenond()) connection->cancel();
}

std::shared_ptr<relay::Connection> TNDaemonClient::tenond() const {
  const std::lock_guard lock(mutex_);
  return tenond_;
}

Result<std::shared_ptr<relay::Connection>> TNDaemonClient::connection() {
  const std::lock_guard lock(mutex_);
  if (tenond_) return tenond_;
  return connectLocked();
}

Result<std::shared_ptr<relay::Connection>> TNDaemonClient::connectLocked() {
  Result<std::shared_ptr<relay::Connection>> connected = relay::Connection::connectToService(serviceName_, replyQueue_);
  if (!connected) return connected;
  (*connected)->setEventHandler(eventHandler(watch_));
  (*connected)->resume();
  tenond_ = *connected;
  return connected;
}

Dictionary TNDaemonClient::request(std::string_view type) const {
  Dictionary request;
  request.set("request", Value(type));
  request.set("version", Value(protocolVersion_));
  return request;
}

Dictionary TNDaemonClient::request(std::string_view type, const std::vector<std::string>& paths) const {
  Dictionary request = this->request(type);
  request.set("paths", convertMemoryToMessage(Value(Array(paths.begin(), paths.end()))));
  return request;
}

void TNDaemonClient::set(Dictionary& request, const PlugInsByPath& plugins) {
  Array uuids;
  Array paths;
  uuids.reserve(plugins.size());
  paths.reserve(plugins.size());
  for (const auto& [path, uuid] : plugins) {
    uuids.emplace_back(uuid);
    paths.emplace_back(path);
  }
  request.set("uuids", Value(std::move(uuids)));
  request.set("paths", Value(std::move(paths)));
}

void TNDaemonClient::set(Dictionary& request, const std::vector<UUID>& uuids) {
  request.set("uuids", Value(Array(uuids.begin(), uuids.end())));
}

void TNDaemonClient::send(Dictionary request, ReplyBlock reply) {
  Value message(std::move(request));
  TN_LOG_DEBUG(log::traffic(), "request: {}", message);
  ReplyBlock logged = [reply = std::move(reply)](relay::Reply received) {
    TN_LOG_DEBUG(log::traffic(), "reply: {}", describe(received));
    reply(std::move(received));
  };

  Result<std::shared_ptr<relay::Connection>> connection = this->connection();
  if (!connection) {
    // Delivered like any reply: later, on the reply queue, never on the
    // sender's thread.
    replyQueue_->async([logged = std::move(logged), error = connection.error()] { logged(error); });
    return;
  }
  (*connection)->sendWithReply(std::move(message), replyQueue_, std::move(logged));
}

relay::Reply TNDaemonClient::sendAndWait(Dictionary request, std::chrono::milliseconds timeout) {
  if (replyQueue_->isCurrent()) {
    dispatch::detail::fatal("TNDaemonClient::sendAndWait on the client's reply queue would wait on itself");
  }
  BlockingReply pending;
  send(std::move(request), pending.block());
  return pending.wait(timeout);
}

}  // namespace tn
