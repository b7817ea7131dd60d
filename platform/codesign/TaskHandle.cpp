#include "platform/codesign/TaskHandle.h"

#include <fmt/format.h>

#include "platform/codesign/EntitlementDocuments.h"
#include "platform/codesign/TrustRule.h"

namespace codesign {

TaskHandle::TaskHandle(ProcessIdentity identity, int executableFd)
    : TaskHandle(std::move(identity), executableFd, TrustSettings::fromEnvironment()) {}

TaskHandle::TaskHandle(ProcessIdentity identity, int executableFd, const TrustSettings& settings)
    : identity_(std::move(identity)),
      entitlements_(loadEntitlements(identity_.executablePath, executableFd, settings)) {
  identity_.executableFile = fileIdentityOf(executableFd);
}

tn::Result<tn::Value> entitlementValue(const TaskHandle& task, std::string_view key) {
  if (task.identity().executablePath.empty() || !task.identity().executableFile) {
    return tn::Error(std::string(kCodesignErrorDomain), static_cast<int64_t>(CodesignErrorCode::NoExecutable),
                     fmt::format("no executable is known for process {}", task.identity().pid));
  }
  return task.entitlements()[key];
}

}  // namespace codesign
