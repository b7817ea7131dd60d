#include "tenond/server/TNDRelayClient.h"

#include <unistd.h>

#include <algorithm>

#include <fmt/format.h>

#include "platform/log/Log.h"
#include "platform/log/LogContext.h"
#include "platform/sandbox/SandboxCheck.h"
#include "platform/value/URL.h"
#include "tenond/requests/Transaction.h"
#include "tenond/server/TNDServer.h"

namespace tnd {

TNDRelayClient::TNDRelayClient(std::shared_ptr<relay::Connection> connection, std::shared_ptr<TNDServer> server)
    : connection_(connection),
      server_(std::move(server)),
      peer_(connection->peerIdentity()),
      path_(peer_.executablePath),
      pid_(peer_.auditToken.pid) {}

std::shared_ptr<TNDRelayClient> TNDRelayClient::initWithConnection(std::shared_ptr<relay::Connection> connection,
                                                                   std::shared_ptr<TNDServer> server) {
  std::shared_ptr<TNDRelayClient> client(new TNDRelayClient(connection, std::move(server)));
  TN_LOG_DEBUG(tn::log::ops(), "new client {} {}", client->pid_, client->path_);
  TN_PROBE_CLIENT_NEW(client->pid_);

  // The connection owns the client from here on; its event handler holds
  // the client strongly as well.
  connection->setContext(client);
  connection->setEventHandler([client](const relay::Event& event) { client->handleEvent(event); });
  // Entitlements and the bundle come from files (a bundle's may be the
  // peer's): they are read on this connection's own queue, not on the
  // listener's, and the connection is resumed only once they are known.
  connection->eventQueue()->async([client, connection] {
    client->establishIdentity();
    connection->resume();
  });
  return client;
}

void TNDRelayClient::establishIdentity() {
  std::shared_ptr<tn::TNBundle> bundle;
  if (!path_.empty()) bundle = tn::TNBundle::withExecutableURL(tn::URL::fileURLWithPath(path_));
  // The file is opened again, through the pid, and must be the one the peer
  // ran when it was accepted.
  const tn::Result<relay::UniqueFd> executable = peer_.openRunningExecutable();
  if (!executable) {
    TN_LOG_DEFAULT(tn::log::ops(), "client {} gets no entitlements: {}", pid_,
                   executable.error().localizedDescription());
  }
  const relay::AuditToken& token = peer_.auditToken;
  codesign::ProcessIdentity process{token.pid, token.uid, token.gid, token.startTime, path_, std::nullopt};
  codesign::TaskHandle task(std::move(process), executable ? executable->get() : -1);
  const std::size_t granted = task.entitlements().dictionary()->size();
  {
    std::lock_guard lock(identityMutex_);
    bundle_ = std::move(bundle);
    task_.emplace(std::move(task));
  }
  TN_LOG_DEBUG(tn::log::ops(), "client {} identified: uid {} executable {} entitlements {} {}", pid_, token.uid,
               path_, granted, isSandboxed() ? "sandboxed" : "not sandboxed");
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
  server_->submitWork(this, [client = shared_from_this(), transaction] {
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
  tn::log::endContext(static_cast<tn::log::ContextId>(pid_));  // the summaries of its suppressed lines
  TN_PROBE_CLIENT_DONE(pid_);
}

tn::Value TNDRelayClient::entitlementValueForKey(const std::string& key) const {
  tn::Result<tn::Value> value = tn::Value();
  {
    std::lock_guard lock(identityMutex_);
    if (!task_) return tn::Value();
    value = codesign::entitlementValue(*task_, key);
  }
  if (!value) {
    TN_LOG_ERROR(tn::log::ops(), "error retrieving entitlements for client {}", pid_);
    return tn::Value();
  }
  // Only what would grant something needs the look at the process.
  if (value->isNull() || !stillRunsItsExecutable()) return tn::Value();
  return *value;
}

bool TNDRelayClient::stillRunsItsExecutable() const {
  if (executableChanged_.load()) return false;
  const tn::Result<relay::UniqueFd> executable = peer_.openRunningExecutable();
  if (executable) return true;
  if (!executableChanged_.exchange(true)) {
    TN_LOG_ERROR(tn::log::ops(), "client {} ({}) holds no entitlements from now on: {}", pid_, path_,
                 executable.error().localizedDescription());
  }
  return false;
}

bool TNDRelayClient::hasEntitlement(const std::string& key) const {
  return codesign::entitlementIsGranted(entitlementValueForKey(key));
}

bool TNDRelayClient::isSandboxed() const { return sandbox::countsAsSandboxed(peer_.seccompFilters); }

bool TNDRelayClient::isPrivilegedUser() const {
  return server_->configuration().isPrivilegedUser(peer_.auditToken);
}

bool TNDRelayClient::mayManage() const { return isPrivilegedUser() && hasEntitlement(kManagerEntitlement); }

std::shared_ptr<tn::TNBundle> TNDRelayClient::bundle() const {
  std::lock_guard lock(identityMutex_);
  return bundle_;
}

std::string TNDRelayClient::description() const {
  const void* self = this;
  if (auto connection = connection_.lock())
    return fmt::format("<TNDRelayClient {} con={} pid={} path={}>", self, connection->description(), pid_, path_);
  return fmt::format("<TNDRelayClient {} NO CONNECTION>", self);
}

}  // namespace tnd
