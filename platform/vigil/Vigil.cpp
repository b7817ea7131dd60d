#include "platform/vigil/Vigil.h"

#include <algorithm>
#include <cerrno>

#include <fmt/format.h>

#include "platform/log/Log.h"
#include "platform/warden/WardenError.h"

namespace vigil {
namespace {

tn::Value failure(int64_t code, std::string message) {
  return tn::Dictionary{{"errorcode", static_cast<uint64_t>(code)}, {"error", std::move(message)}};
}

}  // namespace

tn::Result<std::shared_ptr<Vigil>> Vigil::create(std::shared_ptr<warden::Warden> warden, PrivilegeTest isPrivileged,
                                                 const std::string& serviceName) {
  std::shared_ptr<Vigil> vigil(new Vigil(std::move(warden), std::move(isPrivileged)));
  auto listener = relay::Listener::create(serviceName, tn::dispatch::SerialQueue::create("vigil.listener"));
  if (!listener.ok()) return listener.error();
  vigil->listener_ = std::move(*listener);
  const std::weak_ptr<Vigil> weak = vigil;
  vigil->listener_->setNewConnectionHandler([weak](std::shared_ptr<relay::Connection> connection) {
    if (const auto self = weak.lock()) self->accept(connection);
  });
  vigil->listener_->resume();
  return vigil;
}

Vigil::~Vigil() {
  if (listener_) listener_->cancel();
}

void Vigil::accept(const std::shared_ptr<relay::Connection>& connection) {
  const std::weak_ptr<relay::Connection> weakConnection = connection;
  const std::weak_ptr<Vigil> weak = weak_from_this();
  const void* key = connection.get();
  connection->setEventHandler([weak, weakConnection, key](const relay::Event& event) {
    const auto self = weak.lock();
    if (!self) return;
    if (event.kind == relay::Event::Kind::ConnectionInvalid) return self->connectionEnded(key);
    const auto live = weakConnection.lock();
    if (!live || event.kind != relay::Event::Kind::Message) return;
    live->sendReply(event.message, self->answer(key, *live, event.message.body));
  });
  connection->resume();
}

tn::Value Vigil::answer(const void* key, const relay::Connection& connection, const tn::Value& request) {
  const std::string* type = request["request"].string();
  if (type != nullptr && (*type == "busy" || *type == "idle")) {
    const relay::AuditToken token = connection.auditToken();
    const tn::Result<void> declared = declare(key, token.pid, token.startTime, *type == "busy");
    if (!declared.ok()) return failure(declared.error().code(), declared.error().localizedDescription());
    return tn::Dictionary{};
  }
  if (type == nullptr || *type != "busy-instances") {
    return failure(EINVAL, "the request is none of \"busy\", \"idle\", \"busy-instances\"");
  }
  if (!isPrivileged_ || !isPrivileged_(connection.peerIdentity())) {
    return failure(EPERM, "only privileged users may list busy instances");
  }
  const tn::Array* identifiers = request["identifiers"].array();
  if (identifiers == nullptr) return failure(EINVAL, "\"identifiers\" is not an array");
  std::set<std::string> wanted;
  for (const tn::Value& identifier : *identifiers) {
    if (const std::string* text = identifier.string()) wanted.insert(*text);
  }
  std::vector<tn::Value> busy = busyInstances(wanted);
  return tn::Dictionary{{"instances", tn::Array(busy.begin(), busy.end())}};
}

tn::Result<void> Vigil::declare(const void* key, pid_t pid, uint64_t startTime, bool busy) {
  const std::optional<warden::InstanceInfo> instance = warden_->runningInstance(pid, startTime);
  if (!instance) {
    return warden::makeWardenError(EPERM, fmt::format("process {} is no running plug-in instance", pid));
  }
  const std::lock_guard lock(mutex_);
  if (!busy) {
    busy_.erase(key);
  } else if (!busy_.contains(key)) {
    busy_.emplace(key, Assertion{*instance, nextOrder_++});
    TN_LOG_DEBUG(tn::log::ops(), "vigil: instance {} of {} is busy", pid, instance->bundleIdentifier);
  }
  return {};
}

void Vigil::connectionEnded(const void* key) {
  const std::lock_guard lock(mutex_);
  busy_.erase(key);
}

std::vector<tn::Value> Vigil::busyInstances(const std::set<std::string>& bundleIdentifiers) const {
  std::vector<Assertion> found;
  {
    const std::lock_guard lock(mutex_);
    for (const auto& [key, assertion] : busy_) {
      if (bundleIdentifiers.contains(assertion.instance.bundleIdentifier)) found.push_back(assertion);
    }
  }
  std::sort(found.begin(), found.end(), [](const Assertion& a, const Assertion& b) { return a.order < b.order; });
  std::vector<tn::Value> instances;
  for (const Assertion& assertion : found) {
    // An instance that exited with its connection still being torn down
    // is no longer busy.
    if (!warden_->runningInstance(assertion.instance.pid, assertion.instance.startTime)) continue;
    instances.push_back(tn::Dictionary{{kBundleIdentifierKey, assertion.instance.bundleIdentifier},
                                       {"BNBundleVersion", assertion.instance.bundleVersion},
                                       {"pid", assertion.instance.pid}});
  }
  return instances;
}

}  // namespace vigil
