// Registry: the supervisor's records, kept in memory: per host process the
// plug-in executables registered for it, and the running plug-in
// instances. Internal to platform/warden; the Warden guards it with its
// mutex and keeps the watches that end the records.

#pragma once

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/relay/PollerWatch.h"
#include "platform/value/Value.h"
#include "platform/warden/ActivationOverlay.h"
#include "platform/warden/ProcessHandle.h"

namespace warden {

// One executable registered for one host.
struct Registration {
  std::string executablePath;
  std::string bundlePath;
  std::string bundleIdentifier;
  std::string bundleVersion;  // "1" when the bundle has none
  ActivationOverlay overlay;
};

struct HostRecord {
  ProcessHandle host;
  std::vector<Registration> registrations;
  std::shared_ptr<relay::PollerWatch> exitWatch;  // ends the record with the process
};

// A running plug-in instance. A removal waiting for it to exit is told.
struct InstanceRecord {
  ProcessHandle process;
  pid_t hostPid = 0;
  uint64_t hostStartTime = 0;
  uid_t uid = 0;
  Registration registration;
  std::shared_ptr<relay::PollerWatch> exitWatch;
  std::vector<std::function<void()>> onExit;
};

// What an instance is, for callers outside the supervisor.
struct InstanceInfo {
  pid_t pid = 0;
  uint64_t startTime = 0;
  pid_t hostPid = 0;
  uid_t uid = 0;
  std::string bundleIdentifier;
  std::string bundleVersion;
  std::string executablePath;
  std::string sandboxProfile;
};

InstanceInfo describe(const InstanceRecord& record);

// The listing's dictionaries (docs/warden.md, "list").
tn::Value registrationValue(const HostRecord& host, const Registration& registration);
tn::Value instanceValue(const InstanceRecord& instance);

}  // namespace warden
