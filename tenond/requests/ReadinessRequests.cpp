// "ready": makes each named plug-in launchable for the requesting host (a
// registration with the process supervisor). Every named plug-in is checked
// (hold, host authorization) before any is enabled; then each is enabled,
// all of them even after a failure, and the first failure is the reply.
//
// "access": a read-only sandbox file extension for the bundle of each named
// plug-in, in the order of the request's `uuids`. It checks neither holds nor
// host authorization: a host that names a plug-in may read its files. Not
// atomic: tokens issued before a failure stay issued and are not returned.

#include <fmt/format.h>

#include <unordered_set>

#include "libtenon/model/TNSandboxExtension.h"
#include "platform/log/Log.h"
#include "platform/log/Probes.h"
#include "platform/warden/Warden.h"
#include "platform/value/MessageValue.h"
#include "tenond/plugin/TNDPlugIn.h"
#include "tenond/requests/Transaction.h"
#include "tenond/server/TNDRelayClient.h"
#include "tenond/server/TNDServer.h"

namespace tnd {
namespace {

constexpr const char* kProvideEnvironmentEntitlement = "com.ostrel.developer.tenon.provide-environment";

}  // namespace

std::optional<std::optional<tn::Dictionary>> Transaction::readyEnvironment() {
  const tn::Value* given = request().dictionary()->find("environment");
  if (given == nullptr || !given->isDictionary()) return std::optional<tn::Dictionary>();
  if (!client_->hasEntitlement(kProvideEnvironmentEntitlement)) {
    fail(kErrorNotPermitted, fmt::format("Transmission of environment variables requires the {} host entitlement",
                                         kProvideEnvironmentEntitlement));
    return std::nullopt;
  }
  tn::Value environment = tn::convertMessageToMemory(*given);
  TN_LOG_DEBUG(tn::log::ops(), "pid {} provided {} environment entries", client_->pid(),
               environment.dictionary()->size());
  return std::optional<tn::Dictionary>(*environment.dictionary());
}

void Transaction::readyPlugIns() {
  const std::optional<std::optional<tn::Dictionary>> environment = readyEnvironment();
  if (!environment) return;
  // A set in the order first named; the index keeps a request naming many
  // plug-ins from costing a square on the service queue.
  std::vector<std::shared_ptr<TNDPlugIn>> toEnable;
  std::unordered_set<const TNDPlugIn*> named;
  const bool walked = processUuidList([&](const std::shared_ptr<TNDPlugIn>& plugIn) {
    TN_PROBE_PLUGIN_READY(plugIn->uuidText().c_str());
    if (plugIn->uuid() && server()->holdOnPlugIn(*plugIn->uuid(), client_->peerIdentity().auditToken.uid)) {
      TN_LOG_DEFAULT(tn::log::ops(), "denied access to {} for plugin {}({}): the plug-in is on hold", client_->pid(),
                     plugIn->identifierText(), plugIn->uuidText());
      fail(kErrorNotPermitted,
           fmt::format("access to plugin {} denied: the plug-in is on hold", plugIn->identifierText()));
      return false;
    }
    if (plugIn->isData()) return true;
    if (const std::optional<std::string> refusal = plugIn->allowForClient(*client_)) {
      TN_LOG_DEFAULT(tn::log::ops(), "denied access to {} for plugin {}({}): {}", client_->pid(),
                     plugIn->identifierText(), plugIn->uuidText(), *refusal);
      fail(kErrorNotPermitted, fmt::format("access to plugin {} denied: {}", plugIn->identifierText(), *refusal));
      return false;
    }
    if (named.insert(plugIn.get()).second) toEnable.push_back(plugIn);
    return true;
  });
  if (!walked) return;
  std::optional<tn::Error> firstFailure;
  for (const std::shared_ptr<TNDPlugIn>& plugIn : toEnable) {
    std::optional<tn::Error> failed = plugIn->enableForClient(*client_, *environment, registrarForClient());
    if (failed && !firstFailure) firstFailure = std::move(failed);
  }
  if (firstFailure) {
    fail(kErrorInvalidRequest, *firstFailure);
    return;
  }
  done();
}

std::function<int(const std::string&, const tn::Value&)> Transaction::registrarForClient() const {
  const std::shared_ptr<warden::Warden> supervisor = server()->warden();
  // The token whose pidfd was taken when the host connected: a recycled pid
  // can never inherit the registration.
  const relay::AuditToken host = client_->peerIdentity().auditToken;
  return [supervisor, host](const std::string& executablePath, const tn::Value& overlay) {
    return supervisor ? supervisor->addExternalService(host, executablePath, overlay) : ENOSYS;
  };
}

void Transaction::accessPlugIns() {
  tn::Array tokens;
  const bool walked = processUuidList([&](const std::shared_ptr<TNDPlugIn>& plugIn) {
    const std::optional<tn::URL> bundle = plugIn->url();
    tn::Result<std::string> token =
        bundle ? tn::issueFileExtension(*bundle)
               : tn::Result<std::string>(tn::Error(std::string(tn::kTenonErrorDomain), ENOENT, "no bundle"));
    if (!token) {
      fail(kErrorInvalidRequest, fmt::format("cannot create file extension to {}: {}",
                                             bundle ? bundle->path() : std::string("(null)"), token.error().code()));
      return false;
    }
    tokens.push_back(tn::Value(std::move(*token)));
    return true;
  });
  if (!walked) return;
  reply().set("extensions", tn::convertMemoryToMessage(tn::Value(std::move(tokens))));
  done();
}

}  // namespace tnd
