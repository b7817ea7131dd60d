#include "platform/warden/Registry.h"

namespace warden {

InstanceInfo describe(const InstanceRecord& record) {
  return InstanceInfo{record.process.pid(),
                      record.process.startTime(),
                      record.hostPid,
                      record.uid,
                      record.registration.bundleIdentifier,
                      record.registration.bundleVersion,
                      record.registration.executablePath,
                      record.registration.overlay.sandboxProfile};
}

tn::Value registrationValue(const HostRecord& host, const Registration& registration) {
  return tn::Dictionary{{"host", host.host.pid()},
                        {"BNBundleIdentifier", registration.bundleIdentifier},
                        {"BNBundleVersion", registration.bundleVersion},
                        {"executable", registration.executablePath},
                        {"profile", registration.overlay.sandboxProfile}};
}

tn::Value instanceValue(const InstanceRecord& instance) {
  return tn::Dictionary{{"pid", instance.process.pid()},
                        {"host", instance.hostPid},
                        {"uid", instance.uid},
                        {"BNBundleIdentifier", instance.registration.bundleIdentifier},
                        {"BNBundleVersion", instance.registration.bundleVersion},
                        {"executable", instance.registration.executablePath},
                        {"profile", instance.registration.overlay.sandboxProfile}};
}

}  // namespace warden
