#include "libtenon/model/TNSandboxExtension.h"

#include "platform/log/Log.h"
#include "platform/sandbox/Extensions.h"

namespace tn {

Result<std::string> issueFileExtension(const URL& url) {
  Result<std::string> token =
      sandbox::issueFileExtension(sandbox::kReadOnlyFileExtensionClass, url.path(), sandbox::kCanonicalPath);
  if (token) TN_LOG_DEBUG(log::sandbox(), "issued file extension for {} -> {}", url.path(), *token);
  return token;
}

Result<std::string> issueServiceExtension(std::string_view serviceName) {
  Result<std::string> token = sandbox::issueServiceExtension(kPlugInServiceExtensionClass, serviceName, 0);
  if (token) TN_LOG_DEBUG(log::sandbox(), "issued mach extension for {} -> {}", serviceName, *token);
  return token;
}

TNSandboxExtension::TNSandboxExtension(std::string token) : token_(std::move(token)) {}

TNSandboxExtension::~TNSandboxExtension() { expel(); }

void TNSandboxExtension::consume() {
  if (handle_.load() != kNotConsumed) return;
  const Result<int64_t> consumed = sandbox::consumeExtension(token_);
  if (!consumed) {
    TN_LOG_DEFAULT(log::sandbox(), "failed to consume extension {} - errno={}", token_, consumed.error().code());
    return;
  }
  handle_.store(*consumed);
  TN_LOG_DEBUG(log::sandbox(), "consuming extension {} -> {}", token_, *consumed);
}

void TNSandboxExtension::expel() {
  const int64_t handle = handle_.load();
  if (handle == kNotConsumed) return;
  const Result<void> released = sandbox::releaseExtension(handle);
  if (released) {
    TN_LOG_DEBUG(log::sandbox(), "releasing extension {}", handle);
  } else {
    TN_LOG_DEFAULT(log::sandbox(), "failed to release extension {} - errno={}", handle, released.error().code());
  }
  handle_.store(kNotConsumed);
}

}  // namespace tn
