#pragma once

// TNDHost: the process a plug-in would be used by, as discovery and
// activation ask about it: who it is (pid, executable), what it may do (its
// entitlements) and where it lives (its bundle, whose "PlugIns" directory
// holds the plug-ins dedicated to it).
//
// A connected client (TNDRelayClient) is one. "explain" asks on behalf of a
// host named by its executable's path (ExecutableHost), which has no pid.

#include <cstdint>
#include <memory>
#include <string>

#include "libtenon/model/TNBundle.h"
#include "platform/value/Value.h"

namespace tnd {

class TNDHost {
 public:
  virtual ~TNDHost() = default;

  // The host's process id; 0 for a host that is not a running process.
  virtual int32_t pid() const = 0;
  // The host's executable, for logs and the bundle-relative preference;
  // empty when unknown.
  virtual std::string executablePath() const = 0;
  // The entitlement's value, or null.
  virtual tn::Value entitlementValueForKey(const std::string& key) const = 0;
  // Present and not equal to false.
  virtual bool hasEntitlement(const std::string& key) const = 0;
  // The bundle of the host's executable, or none.
  virtual std::shared_ptr<tn::TNBundle> bundle() const = 0;

 protected:
  TNDHost() = default;
  TNDHost(const TNDHost&) = default;
  TNDHost& operator=(const TNDHost&) = default;
};

}  // namespace tnd
