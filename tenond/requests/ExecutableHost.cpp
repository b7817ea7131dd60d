#include "tenond/requests/ExecutableHost.h"

#include <fcntl.h>
#include <limits.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include <fmt/format.h>

#include "platform/codesign/EntitlementDocuments.h"
#include "platform/codesign/EntitlementGrant.h"
#include "platform/value/URL.h"

namespace tnd {

tn::Result<std::shared_ptr<ExecutableHost>> ExecutableHost::forExecutable(const std::string& path) {
  char resolved[PATH_MAX];
  if (path.empty() || path.front() != '/' || path.find('\0') != std::string::npos ||
      ::realpath(path.c_str(), resolved) == nullptr) {
    return tn::Error(std::string(tn::kTenonErrorDomain), 9, fmt::format("invalid host executable: {}", path));
  }
  const int fd = ::open(resolved, O_PATH | O_CLOEXEC);
  struct stat status {};
  if (fd < 0 || ::fstat(fd, &status) != 0 || !S_ISREG(status.st_mode)) {
    if (fd >= 0) ::close(fd);
    return tn::Error(std::string(tn::kTenonErrorDomain), 9, fmt::format("invalid host executable: {}", path));
  }
  tn::Value entitlements = codesign::loadEntitlements(resolved, fd, codesign::TrustSettings::fromEnvironment());
  ::close(fd);
  auto bundle = tn::TNBundle::withExecutableURL(tn::URL::fileURLWithPath(resolved));
  return std::shared_ptr<ExecutableHost>(new ExecutableHost(resolved, std::move(entitlements), std::move(bundle)));
}

tn::Value ExecutableHost::entitlementValueForKey(const std::string& key) const { return entitlements_[key]; }

bool ExecutableHost::hasEntitlement(const std::string& key) const {
  return codesign::entitlementIsGranted(entitlementValueForKey(key));
}

}  // namespace tnd
