#pragma once

// ExecutableHost: a host named by the path of its executable rather than
// connected: what "explain" asks about when a privileged client wants to
// know what another program would be offered. Its entitlements are read
// from the trusted documents for that file, as they would be for a process
// running it; it has no pid.

#include <memory>
#include <string>

#include "platform/value/Result.h"
#include "tenond/plugin/TNDHost.h"

namespace tnd {

class ExecutableHost final : public TNDHost {
 public:
  // The host for the executable at `path` (absolute; links followed), or
  // an error naming the path when there is no such file.
  static tn::Result<std::shared_ptr<ExecutableHost>> forExecutable(const std::string& path);

  int32_t pid() const override { return 0; }
  std::string executablePath() const override { return path_; }
  tn::Value entitlementValueForKey(const std::string& key) const override;
  bool hasEntitlement(const std::string& key) const override;
  std::shared_ptr<tn::TNBundle> bundle() const override { return bundle_; }

 private:
  ExecutableHost(std::string path, tn::Value entitlements, std::shared_ptr<tn::TNBundle> bundle)
      : path_(std::move(path)), entitlements_(std::move(entitlements)), bundle_(std::move(bundle)) {}

  const std::string path_;
  const tn::Value entitlements_;
  const std::shared_ptr<tn::TNBundle> bundle_;
};

}  // namespace tnd
