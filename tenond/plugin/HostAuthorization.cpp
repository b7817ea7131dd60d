// TNDPlugIn::allowForClient: may this host use this plug-in at all? Two
// tests, in this order: the host's own restriction (an entitlement holding
// rules the plug-in must match), then the plug-in's demand (a host
// entitlement every host of it must hold). The answer is the reason for a
// refusal, or none.
//
// TNDPlugIn::allowedPrivyServices: what the user granted the plug-in's
// application in the consent store.

#include <fmt/format.h>

#include "platform/log/Log.h"
#include "platform/privy/ConsentStore.h"
#include "platform/registrar/Records.h"
#include "tenond/plugin/TNDPlugIn.h"

namespace tnd {

std::optional<std::string> TNDPlugIn::allowForClient(const TNDHost& host, const TNDMatchContext& context) const {
  const tn::Value restriction = host.entitlementValueForKey(kHostRestrictionEntitlement);
  if (!restriction.isNull()) {
    if (!restriction.isDictionary()) return std::string("invalid host restriction entitlement");
    if (!match(restriction, context)) return std::string("the host's plug-in entitlement does not allow this plug-in");
  }
  const tn::Value demanded = pluginKey(kHostEntitlementKey);
  if (!demanded.isNull()) {
    // A demand that names no entitlement (not a string) names one no host
    // can hold.
    const std::string* name = demanded.string();
    if (name == nullptr || !host.hasEntitlement(*name)) {
      return fmt::format("the host does not have the \"{}\" entitlement",
                         name != nullptr ? *name : demanded.description());
    }
  }
  return std::nullopt;
}

std::set<std::string> TNDPlugIn::allowedPrivyServices() const {
  if (!containingUrl()) return {};
  // Consent is kept per application, by its bundle identifier.
  const registrar::PlugInPtr record = getProxy();
  const registrar::AppPtr app = record ? record->containingApp() : nullptr;
  const std::optional<std::string> application = app ? app->identifier() : std::nullopt;
  if (!application) {
    TN_LOG_INFO(tn::log::ops(), "failed to create bundle for {}", path().value_or(""));
    return {};
  }
  return privy::ConsentStore().allowedServices(*application);
}

}  // namespace tnd
