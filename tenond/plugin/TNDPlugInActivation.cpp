// TNDPlugIn's activation: the service configuration and activation overlay
// that make a plug-in launchable for one host (enableForClient), and whether
// an instance of it is busy (checkBusy). Activation keeps nothing in the
// daemon: the registration lives in the process supervisor, keyed by the
// host's process; each "ready" registers again.

#include <cstdlib>

#include <fmt/format.h>

#include "libtenon/model/PlugInKeys.h"
#include "libtenon/model/TNBundle.h"
#include "platform/log/Log.h"
#include "platform/value/MessageValue.h"
#include "tenond/plugin/TNDPlugIn.h"

namespace tnd {
namespace {

std::string describeText(const std::optional<std::string>& text) { return text.value_or("(null)"); }

// The sandbox profile of an extension point with its own, by the table's
// rows 3 to 8 (read from the record's plug-in dictionary).
std::optional<std::string> dedicatedProfile(const std::string& extensionPoint) {
  static const std::pair<const char*, const char*> kRows[] = {
      {"com.ostrel.glance.extension.view", "glanced"},
      {"com.ostrel.glance.view", "glance-view"},
      {"com.ostrel.glance.miniature", "glance-miniature"},
      {"com.ostrel.app.headless-extension", "sketchpad-tools"},
      {"com.ostrel.app.headless-extension.many-instances", "sketchpad-tools"},
      {"com.ostrel.callerscope.note-sieve", "note-sieve"},
  };
  for (const auto& [point, profile] : kRows) {
    if (extensionPoint == point) return std::string(profile);
  }
  return std::nullopt;
}

}  // namespace

std::string TNDPlugIn::sandboxProfile() const {
  const tn::Value ownPoint = pluginKey(tn::keys::kExtensionPointIdentifier);
  if (ownPoint == tn::Value(kEntryPadExtensionPoint)) {
    // Open access: the plug-in asks for it and its application was granted
    // network access for entry pads. Only then is the consent store read.
    const bool asks = attribute(kRequestsOpenAccessKey) == tn::Value(true);
    return asks && allowedPrivyServices().contains(kEntryPadNetworkService) ? "plugin" : "entry-pad";
  }
  if (ownPoint == tn::Value(kTrafficScreenExtensionPoint)) return "traffic-screen";
  const tn::Value recordPoint = plugInDictionary()[tn::keys::kExtensionPointIdentifier];
  if (const std::string* point = recordPoint.string()) {
    if (std::optional<std::string> profile = dedicatedProfile(*point)) return *profile;
  }
  return "plugin";
}

tn::Dictionary TNDPlugIn::mergedEnvironment(const std::optional<tn::Dictionary>& hostEnvironment) const {
  tn::Dictionary environment = hostEnvironment.value_or(tn::Dictionary());
  if (const std::optional<tn::URL> container = dataContainerURL()) {
    environment.set("HOME", container->path());
    environment.set("BNFIXED_USER_HOME", container->path());
    environment.set("TMPDIR", container->path() + "/tmp");
  } else {
    TN_LOG_DEBUG(tn::log::ops(), "no data container for plug-in {}({}) {} at {}", identifierText(),
                 version().description(), uuidText(), describeText(path()));
  }
  return environment;
}

tn::Value TNDPlugIn::activationOverlay(const std::optional<tn::Dictionary>& hostEnvironment) const {
  tn::Dictionary environment = mergedEnvironment(hostEnvironment);
  const std::string profile = sandboxProfile();
  if (const char* sdk = std::getenv("TNTEST_SDK")) environment.set("TNTEST_SDK", std::string(sdk));

  const tn::Value bundleService = infoKey(kRelayServiceKey);
  tn::Dictionary service;
  if (const tn::Dictionary* configured = bundleService.dictionary()) {
    TN_LOG_DEBUG(tn::log::rg(), "raw RelayService={}", bundleService.description());
    service = *configured;
  } else {
    TN_LOG_INFO(tn::log::ops(), "no RelayService for plug-in; database returned {}",
                bundleService.isNull() ? std::string("(null)") : bundleService.description());
  }
  if (const tn::Dictionary* own = service.get(kEnvironmentVariablesKey).dictionary()) {
    for (const auto& [name, value] : *own) environment.set(name, value);
  }
  service.set(kEnvironmentVariablesKey, tn::Value(std::move(environment)));
  service.set(kSandboxProfileKey, tn::Value(profile));
  service.set(kOmitSandboxParametersKey, tn::Value(true));
  TN_LOG_INFO(tn::log::ops(), "assigning plug-in {}({}) {} to {} sandbox", identifierText(),
              version().description(), uuidText(), profile);
  tn::Dictionary overlay;
  overlay.set(std::string(kRelayServiceKey), tn::convertMemoryToMessage(tn::Value(std::move(service))));
  overlay.set(kBundlePackageTypeKey, tn::Value(kRelayPackageType));
  return tn::Value(std::move(overlay));
}

std::optional<tn::Error> TNDPlugIn::enableForClient(const TNDHost& host,
                                                    const std::optional<tn::Dictionary>& environment,
                                                    const ExternalServiceRegistrar& registrar) const {
  const tn::Value overlay = activationOverlay(environment);
  TN_LOG_DEFAULT(tn::log::ops(), "allowing host {} {} to use plug-in {}({}) uuid={} at {}", host.pid(),
                 host.executablePath(), identifierText(), version().description(), uuidText(),
                 describeText(path()));
  const std::shared_ptr<tn::TNBundle> bundle = url() ? tn::TNBundle::withURL(*url()) : nullptr;
  const std::optional<std::string> executable = bundle ? bundle->executablePath() : std::nullopt;
  if (!executable) {
    TN_LOG_ERROR(tn::log::ops(), "failed to obtain execPath for plug-in {}({}) bundle={}", identifierText(),
                 uuidText(), describeText(path()));
    return tn::Error(std::string(tn::kTenonErrorDomain), 4,
                     fmt::format("cannot obtain executable path for plug-in {}({})", identifierText(),
                                 uuidText()));
  }
  TN_LOG_DEBUG(tn::log::ops(), "activation overlay={}", overlay.description());
  if (const int error = registrar(*executable, overlay); error != 0) {
    TN_LOG_ERROR(tn::log::ops(), "warden error {} trying to allow {} {} to use plug-in {}({}) uuid={} at {}", error,
                 host.pid(), host.executablePath(), identifierText(), version().description(), uuidText(),
                 describeText(path()));
    return tn::Error(std::string(tn::kTenonErrorDomain), 4,
                     fmt::format("unable to enable plug-in {}({})", identifierText(), uuidText()));
  }
  return std::nullopt;
}

std::optional<tn::Value> TNDPlugIn::checkBusy(const BusyInstanceSource& busyInstances) const {
  const tn::Value bundleIdentifier = infoKey(tn::keys::kBundleIdentifier);
  const std::string* bundle = bundleIdentifier.string();
  if (bundle == nullptr) return std::nullopt;
  for (const tn::Value& instance : busyInstances({*bundle})) {
    const tn::Value& busy = instance[kBusyBundleIdentifierKey];
    if (busy.isString()) return tn::Value(tn::Dictionary{{kBusyBundleIdentifierKey, busy}});
    TN_LOG_ERROR(tn::log::ops(), "vigild reported incomplete bundle for plug-in {}/{}", identifierText(),
                 uuidText());
  }
  return std::nullopt;
}

}  // namespace tnd
