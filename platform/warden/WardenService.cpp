#include "platform/warden/WardenService.h"

#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <string_view>

#include <fmt/format.h>

#include "platform/log/Log.h"
#include "platform/warden/WardenError.h"

namespace warden {
namespace {

tn::Value failure(int64_t code, std::string message) {
  return tn::Dictionary{{"errorcode", static_cast<uint64_t>(code)}, {"error", std::move(message)}};
}

tn::Value failure(const tn::Error& error) {
  return failure(error.code() > 0 ? error.code() : EINVAL, error.localizedDescription());
}

bool testHooksEnabled() {
  const char* value = std::getenv("TENON_WARDEN_TEST_HOOKS");
  return value != nullptr && std::string_view(value) == "1";
}

tn::Value registerForTest(Warden& warden, const relay::PeerIdentity& peer, const tn::Value& request) {
  if (peer.auditToken.uid != 0 && peer.auditToken.uid != ::geteuid()) {
    return failure(EPERM, "only root or the supervisor's user may register");
  }
  const std::optional<int64_t> host = request["host"].int64();
  const std::string* executable = request["executable"].string();
  if (!host || *host <= 0 || executable == nullptr) {
    return failure(EINVAL, "\"register\" needs \"host\" (a pid) and \"executable\" (a path)");
  }
  tn::Result<ProcessHandle> process = ProcessHandle::open(static_cast<pid_t>(*host));
  if (!process.ok()) return failure(process.error());
  tn::Result<void> registered = warden.registerExternalService(*process, *executable, request["overlay"]);
  if (!registered.ok()) return failure(registered.error());
  return tn::Dictionary{};
}

}  // namespace

tn::Result<std::unique_ptr<WardenService>> WardenService::create(std::shared_ptr<Warden> warden,
                                                                 PrivilegeTest isPrivileged,
                                                                 const std::string& serviceName) {
  std::unique_ptr<WardenService> service(new WardenService(std::move(warden), std::move(isPrivileged)));
  auto listener = relay::Listener::create(serviceName, tn::dispatch::SerialQueue::create("warden.listener"));
  if (!listener.ok()) return listener.error();
  service->listener_ = std::move(*listener);
  // The handler holds what it needs itself: a connection accepted while
  // the service is being destroyed still finds it.
  service->listener_->setNewConnectionHandler(
      [warden = service->warden_, isPrivileged = service->isPrivileged_](std::shared_ptr<relay::Connection> connection) {
        accept(connection, warden, isPrivileged);
      });
  service->listener_->resume();
  return service;
}

WardenService::WardenService(std::shared_ptr<Warden> warden, PrivilegeTest isPrivileged)
    : warden_(std::move(warden)), isPrivileged_(std::move(isPrivileged)) {}

WardenService::~WardenService() {
  if (listener_) listener_->cancel();
}

void WardenService::accept(const std::shared_ptr<relay::Connection>& connection, std::shared_ptr<Warden> warden,
                           PrivilegeTest isPrivileged) {
  // The handler holds the connection weakly (a connection keeps itself alive
  // until it ends) and the supervisor strongly.
  const std::weak_ptr<relay::Connection> weak = connection;
  connection->setEventHandler([weak, warden = std::move(warden),
                               isPrivileged = std::move(isPrivileged)](const relay::Event& event) {
    const auto live = weak.lock();
    if (!live || event.kind != relay::Event::Kind::Message) return;
    relay::UniqueFd hostSocket;
    tn::Value reply = answer(*warden, isPrivileged, live->peerIdentity(), event.message.body, hostSocket);
    relay::Descriptors descriptors;
    if (hostSocket.valid()) descriptors.push_back(std::move(hostSocket));
    if (tn::Result<void> sent = live->trySendReply(event.message, std::move(reply), std::move(descriptors));
        !sent.ok()) {
      TN_LOG_INFO(tn::log::ops(), "warden: reply to {} not sent: {}", live->description(),
                  sent.error().description());
    }
  });
  connection->resume();
}

tn::Value WardenService::answer(Warden& warden, const PrivilegeTest& isPrivileged, const relay::PeerIdentity& peer,
                                const tn::Value& request, relay::UniqueFd& hostSocket) {
  const std::string* type = request["request"].string();
  if (type == nullptr) return failure(EINVAL, "the request has no \"request\" string");
  const relay::AuditToken& token = peer.auditToken;
  if (*type == "list") {
    const bool everything = isPrivileged && isPrivileged(peer);
    return warden.listing(everything ? std::nullopt
                                       : std::optional<std::pair<pid_t, uint64_t>>({token.pid, token.startTime}));
  }
  if (*type == "register" && testHooksEnabled()) return registerForTest(warden, peer, request);
  if (*type != "start") return failure(EINVAL, fmt::format("unknown request \"{}\"", *type));
  const std::string* plugIn = request["plug-in"].string();
  if (plugIn == nullptr || plugIn->empty()) return failure(EINVAL, "\"plug-in\" is not a non-empty string");
  tn::Result<Warden::Started> started = warden.start(token, *plugIn);
  if (!started.ok()) {
    TN_LOG_INFO(tn::log::ops(), "warden: start of {} for process {} refused: {}", *plugIn, token.pid,
                started.error().localizedDescription());
    return failure(started.error());
  }
  hostSocket = std::move(started->hostSocket);
  return tn::Dictionary{{"pid", started->instance.pid},
                        {"BNBundleIdentifier", started->instance.bundleIdentifier},
                        {"BNBundleVersion", started->instance.bundleVersion}};
}

}  // namespace warden
