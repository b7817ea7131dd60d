#include "tenond/server/TNDServer.h"

#include <algorithm>
#include <mutex>

#include "platform/dispatch/MainLoop.h"
#include "platform/log/Log.h"
#include "platform/notify/Notify.h"
#include "platform/relay/RelayError.h"
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
  if (!server->initWithDatabase(databasePath, tn::dispatch::mainQueue())) return nullptr;

  server->relayQueue_ = tn::dispatch::SerialQueue::create("relay");
  server->mainQueue_ = tn::dispatch::SerialQueue::create("service", kServiceQualityOfService);
  server->syncQueue_ = tn::dispatch::SerialQueue::create("serverSync");

  auto listener = relay::Listener::create(serviceName, server->relayQueue_);
  if (!listener) {
    TN_LOG_ERROR(tn::log::ops(), "cannot listen as {}: {}", serviceName, listener.error().localizedDescription());
    return nullptr;
  }
  server->service_ = std::move(*listener);
  {
    std::lock_guard lock(gServerMutex);
    gServer = server;
  }
  server->setDelegate(server);
  server->installListenerHandlers();
  return server;
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

void TNDServer::submitWork(std::function<void()> work) { mainQueue_->async(std::move(work)); }

void TNDServer::stop() {
  service_->cancel();
  syncQueue_->sync([&] {
    for (const auto& hold : holds_)
      TN_LOG_DEBUG(tn::log::ops(), "releasing plug-in hold {} because server is stopping", hold->uuid().string());
    holds_.clear();
    notifyAnnotationChange();
  });
}

bool TNDServer::holdOnPlugIn(const tn::UUID& plugIn) {
  return syncQueue_->sync([&] {
    for (const auto& hold : holds_)
      if (hold->blocks(plugIn)) return true;
    return false;
  });
}

void TNDServer::addHold(std::shared_ptr<TNDPlugInHold> hold) {
  syncQueue_->sync([&] { holds_.push_back(std::move(hold)); });
  notifyAnnotationChange();
}

void TNDServer::unholdToken(const tn::UUID& token) {
  syncQueue_->sync([&] {
    for (auto it = holds_.begin(); it != holds_.end(); ++it) {
      if ((*it)->uuid() != token) continue;
      TN_LOG_DEBUG(tn::log::ops(), "releasing plug-in hold {} at client's request", token.string());
      holds_.erase(it);
      notifyAnnotationChange();
      return;
    }
  });
}

void TNDServer::unholdClient(const std::shared_ptr<TNDRelayClient>& client) {
  syncQueue_->sync([&] {
    for (;;) {
      auto it = std::find_if(holds_.begin(), holds_.end(), [&](const auto& h) { return h->placedBy(client); });
      if (it == holds_.end()) return;
      TN_LOG_DEBUG(tn::log::ops(), "releasing plug-in hold {} for dead client pid {}", (*it)->uuid().string(),
                   client->pid());
      holds_.erase(it);
      notifyAnnotationChange();
    }
  });
}

size_t TNDServer::holdCount() {
  return syncQueue_->sync([&] { return holds_.size(); });
}

void TNDServer::removedPlugIns(const registrar::PlugInList& records) {
  // Forced termination of running instances comes with the holds' issue;
  // until then an uninstall only leaves the cache.
  for (const registrar::PlugInPtr& record : records)
    TN_LOG_DEBUG(tn::log::ops(), "plug-in {} removed; terminating its instances is not available yet",
                 record->identifier());
}

}  // namespace tnd
