#include "tenond/server/TNDServer.h"

#include <algorithm>
#include <mutex>

#include "platform/dispatch/MainLoop.h"
#include "platform/log/Log.h"
#include "platform/notify/Notify.h"
#include "platform/relay/KeepAlive.h"
#include "platform/relay/RelayError.h"
#include "platform/types/TypeHierarchy.h"
#include "tenond/QueueRanks.h"
#include "tenond/server/FileLimit.h"
#include "tenond/server/PlugInTermination.h"
#include "tenond/server/TNDPlugInHold.h"
#include "tenond/server/TNDRelayClient.h"

namespace tnd {
namespace {

std::mutex gServerMutex;
std::shared_ptr<TNDServer> gServer;  // the process's one server

}  // namespace

std::shared_ptr<TNDServer> TNDServer::initForService(const std::string& serviceName,
                                                     const std::optional<std::string>& databasePath) {
  std::shared_ptr<TNDServer> server(new TNDServer());
  server->configuration_ = TNDConfiguration::load();
  if (!server->initWithDatabase(databasePath, tn::dispatch::mainQueue())) return nullptr;

  server->relayQueue_ = tn::dispatch::SerialQueue::create("relay");
  server->mainQueue_ = tn::dispatch::SerialQueue::create("service", kServiceQualityOfService);
  server->mainQueue_->setLockRank(kServiceQueueRank);
  server->serviceTurns_ = tn::dispatch::FairQueue::create(server->mainQueue_);
  server->syncQueue_ = tn::dispatch::SerialQueue::create("serverSync");
  server->syncQueue_->setLockRank(kLeafQueueRank);

  auto listener = relay::Listener::create(serviceName, server->relayQueue_);
  if (!listener) {
    TN_LOG_ERROR(tn::log::ops(), "cannot listen as {}: {}", serviceName, listener.error().localizedDescription());
    return nullptr;
  }
  server->service_ = std::move(*listener);
  const relay::Listener::Limits limits =
      connectionLimits(currentFileLimit(), server->configuration_.connectionsPerUser,
                       server->configuration_.connectionsTotal);
  server->service_->setLimits(limits);
  TN_LOG_DEBUG(tn::log::ops(), "connections: at most {} per user, {} in all ({} kept for root), {} requests "
               "outstanding per connection", limits.connectionsPerUser, limits.connectionsTotal,
               limits.privilegedReserve, limits.outstandingRequests);
  {
    std::lock_guard lock(gServerMutex);
    gServer = server;
  }
  // Matching reads elections through the server's database, and the type
  // hierarchy is loaded (its problems logged) now rather than at the first
  // match.
  TNDMatchContext::setAnnotationSource([](const TNDPlugIn& plugIn) -> std::optional<tn::Dictionary> {
    const std::shared_ptr<TNDServer> current = TNDServer::server();
    return current ? current->annotationForPlugIn(plugIn) : std::nullopt;
  });
  types::TypeHierarchy::system();
  server->startPlatformServices();
  // The registrar may already be telling of uninstalls (a warm start
  // verifies its store in the background): the server hears of them once
  // the supervisor it terminates them through exists.
  server->setDelegate(server);
  server->installListenerHandlers();
  return server;
}

void TNDServer::startPlatformServices() {
  warden::Warden::Limits limits;
  if (configuration_.terminationGraceSeconds)
    limits.terminationGrace = std::chrono::seconds(*configuration_.terminationGraceSeconds);
  warden_ = warden::Warden::create(limits);
  const TNDConfiguration configuration = configuration_;
  const auto isPrivileged = [configuration](const relay::PeerIdentity& peer) {
    return configuration.isPrivilegedUser(peer.auditToken);
  };
  auto wardenService = warden::WardenService::create(warden_, isPrivileged);
  if (wardenService.ok()) {
    wardenService_ = std::move(*wardenService);
  } else {
    TN_LOG_ERROR(tn::log::ops(), "cannot serve {}: {}", warden::kWardenServiceName,
                 wardenService.error().localizedDescription());
  }
  auto busyService = vigil::Vigil::create(warden_, isPrivileged);
  if (busyService.ok()) {
    vigil_ = std::move(*busyService);
  } else {
    TN_LOG_ERROR(tn::log::ops(), "cannot serve {}: {}", vigil::kVigilServiceName,
                 busyService.error().localizedDescription());
  }
}

std::shared_ptr<TNDServer> TNDServer::server() {
  std::lock_guard lock(gServerMutex);
  return gServer;
}

void TNDServer::installListenerHandlers() {
  // The handlers hold the server strongly; it lives as long as the process.
  auto self = shared_from_this();
  service_->setNewConnectionHandler([self](std::shared_ptr<relay::Connection> connection) {
    TNDRelayClient::initWithConnection(std::move(connection), self);
  });
  service_->setErrorHandler([](const tn::Error& error) {
    if (relay::isRelayError(error, relay::RelayErrorCode::ConnectionInvalid))
      TN_LOG_DEFAULT(tn::log::ops(), "potentially unexpected error from relay: {}", error.description());
    else
      TN_LOG_ERROR(tn::log::ops(), "unexpected error from relay: {}", error.description());
  });
}

void TNDServer::run() {
  service_->resume();
  tn::dispatch::runMainLoop();
}

void TNDServer::submitWork(const TNDRelayClient* client, std::function<void()> work) {
  serviceTurns_->async(client, std::move(work));
}

// Hold changes post outside "serverSync": a post touches the file system,
// and nothing that can stall (however briefly) belongs inside the queue that
// every hold change and SIGTERM go through. Each function collects how many
// holds it released inside the queue and posts that many times after it.
void TNDServer::postAnnotationChanges(size_t count) {
  for (size_t i = 0; i < count; ++i) notifyAnnotationChange();
}

void TNDServer::stop() {
  service_->cancel();
  syncQueue_->sync([&] {
    for (const auto& hold : holds_)
      TN_LOG_DEBUG(tn::log::ops(), "releasing plug-in hold {} because server is stopping", hold->uuid().string());
    holds_.clear();
  });
  postAnnotationChanges(1);  // one, even with no holds
}

bool TNDServer::isIdle() const {
  if (service_->connectionCount() != 0 || relay::keepAliveCount() != 0) return false;
  if (wardenService_ && wardenService_->connectionCount() != 0) return false;
  if (vigil_ && vigil_->connectionCount() != 0) return false;
  return warden_->registrationCount() == 0 && warden_->instanceCount() == 0;
}

void TNDServer::stopAccepting() { service_->cancel(); }

bool TNDServer::holdOnPlugIn(const tn::UUID& plugIn, uid_t user) {
  return syncQueue_->sync([&] {
    for (const auto& hold : holds_)
      if (hold->blocks(plugIn, user)) return true;
    return false;
  });
}

std::unordered_set<tn::UUID> TNDServer::heldPlugIns(uid_t user) {
  return syncQueue_->sync([&] {
    std::unordered_set<tn::UUID> held;
    for (const auto& hold : holds_)
      if (hold->reaches(user)) held.insert(hold->blocked().begin(), hold->blocked().end());
    return held;
  });
}

bool TNDServer::addHold(std::shared_ptr<TNDPlugInHold> hold) {
  const bool added = syncQueue_->sync([&] {
    if (const std::shared_ptr<TNDRelayClient> client = hold->client()) {
      const auto placed = [&](const auto& held) { return held->placedBy(client); };
      if (static_cast<size_t>(std::count_if(holds_.begin(), holds_.end(), placed)) >= kHoldsPerClient) return false;
    }
    holds_.push_back(std::move(hold));
    return true;
  });
  if (added) postAnnotationChanges(1);
  return added;
}

void TNDServer::unholdToken(const tn::UUID& token) {
  const size_t released = syncQueue_->sync([&]() -> size_t {
    for (auto it = holds_.begin(); it != holds_.end(); ++it) {
      if ((*it)->uuid() != token) continue;
      TN_LOG_DEBUG(tn::log::ops(), "releasing plug-in hold {} at client's request", token.string());
      holds_.erase(it);
      return 1;
    }
    return 0;
  });
  postAnnotationChanges(released);
}

void TNDServer::unholdClient(const std::shared_ptr<TNDRelayClient>& client) {
  const size_t released = syncQueue_->sync([&]() -> size_t {
    const auto placed = [&](const auto& hold) { return hold->placedBy(client); };
    for (const auto& hold : holds_) {
      if (placed(hold))
        TN_LOG_DEBUG(tn::log::ops(), "releasing plug-in hold {} for dead client pid {}", hold->uuid().string(),
                     client->pid());
    }
    return std::erase_if(holds_, placed);
  });
  postAnnotationChanges(released);
}

size_t TNDServer::holdCount() {
  return syncQueue_->sync([&] { return holds_.size(); });
}

void TNDServer::terminatePlugIns(const registrar::PlugInList& records, std::function<void()> completion,
                                 std::optional<uid_t> onlyForUser) {
  const std::shared_ptr<warden::Warden> supervisor = warden_;
  PlugInTermination::start(
      records,
      [supervisor, onlyForUser](const std::string& identifier, const std::string& version,
                                std::shared_ptr<tn::dispatch::SerialQueue> queue, std::function<void(int)> reply) {
        supervisor->removeExternalService(identifier, version, std::move(queue), std::move(reply), onlyForUser);
      },
      std::move(completion));
}

void TNDServer::removedPlugIns(const registrar::PlugInList& records) {
  terminatePlugIns(records, [description = PlugInTermination::describe(records)] {
    TN_LOG_DEBUG(tn::log::ops(), "removal complete for {}", description);
  });
}

}  // namespace tnd
