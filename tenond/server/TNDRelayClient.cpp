#include "tenond/server/TNDRelayClient.h"

#include <fmt/format.h>

#include "platform/log/Log.h"
#include "platform/sandbox/SandboxCheck.h"
#include "platform/value/URL.h"
#include "tenond/requests/Transaction.h"
#include "tenond/server/TNDServer.h"

namespace tnd {

TNDRelayClient::TNDRelayClient(std::shared_ptr<relay::Connection> connection, std::shared_ptr<TNDServer> server)
    : connection_(connection), server_(std::move(server)), pid_(connection->pid()) {}

std::shared_ptr<TNDRelayClient> TNDRelayClient::initWithConnection(std::shared_ptr<relay::Connection> connection,
                                                                   std::shared_ptr<TNDServer> server) {
  std::shared_ptr<TNDRelayClient> client(new TNDRelayClient(connection, std::move(server)));

  // The relay layer read the executable path once, at accept time, and
  // checked it against the peer's start time.
  const relay::AuditToken token = connection->auditToken();
  client->path_ = connection->executablePath();
  if (!client->path_.empty())
    client->bundle_ = tn::TNBundle::withExecutableURL(tn::URL::fileURLWithPath(client->path_));

  TN_LOG_DEBUG(tn::log::ops(), "new client {} {}", client->pid_, client->path_);
  TN_PROBE_CLIENT_NEW(client->pid_);

  client->task_.emplace(codesign::ProcessIdentity{token.pid, token.uid, token.gid, token.startTime, client->path_});

  // The connection owns the client from here on; its event handler holds
  // the client strongly as well.
  connection->setContext(client);
  connection->setEventHandler([client](const relay::Event& event) { client->handleEvent(event); });
  connection->resume();
  return client;
}

int32_t TNDRelayClient::pid() const { return pid_; }

void TNDRelayClient::handleEvent(const relay::Event& event) {
  switch (event.kind) {
    case relay::Event::Kind::Message: handleRequest(event.message); break;
    case relay::Event::Kind::TerminationImminent: dying(); break;
    case relay::Event::Kind::ConnectionInvalid: dead(); break;
    default:
      TN_LOG_ERROR(tn::log::ops(), "unexpected error type from relay: {}", event.reason);
      break;
  }
}

void TNDRelayClient::handleRequest(const relay::Message& message) {
  TN_PROBE_REQUEST_INPUT(pid_, [&] { return message.body.description(); });
  auto transaction = std::make_shared<Transaction>(message, shared_from_this());
  // The unit of work holds the client and the transaction until it has run.
  server_->submitWork([client = shared_from_this(), transaction] {
    const uint32_t count = client->requestCount() + 1;
    client->setRequestCount(count);
    if (count % 1000 == 0) TN_LOG_DEBUG(tn::log::ops(), "client {} used {} requests so far", client->pid(), count);
    transaction->dispatch();
  });
}

void TNDRelayClient::dying() { TN_LOG_DEBUG(tn::log::ops(), "client {} termination imminent", pid_); }

void TNDRelayClient::dead() {
  server_->unholdClient(shared_from_this());
  TN_LOG_DEBUG(tn::log::ops(), "client {} is dead", pid_);
  acceptWork_ = false;
  TN_PROBE_CLIENT_DONE(pid_);
}

tn::Value TNDRelayClient::entitlementValueForKey(const std::string& key) const {
  if (!task_) return tn::Value();
  auto value = codesign::entitlementValue(*task_, key);
  if (!value) {
    TN_LOG_ERROR(tn::log::ops(), "error retrieving entitlements for client {}", pid_);
    return tn::Value();
  }
  return *value;
}

bool TNDRelayClient::hasEntitlement(const std::string& key) const {
  return codesign::entitlementIsGranted(entitlementValueForKey(key));
}

bool TNDRelayClient::isSandboxed() const {
  auto connection = connection_.lock();
  if (!connection) return false;
  const relay::AuditToken token = connection->auditToken();
  return sandbox::isProcessSandboxed(token.pid, token.startTime);
}

std::string TNDRelayClient::description() const {
  const void* self = this;
  if (auto connection = connection_.lock())
    return fmt::format("<TNDRelayClient {} con={} pid={} path={}>", self, connection->description(), pid_, path_);
  return fmt::format("<TNDRelayClient {} NO CONNECTION>", self);
}

}  // namespace tnd
