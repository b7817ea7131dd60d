#include "libtenon/model/TNSandboxExtension.h"

#include <cerrno>
#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <memory>

#include <fmt/format.h>

#include "platform/log/Log.h"
#include "platform/sandbox/Extensions.h"
#include "platform/sandbox/SandboxKey.h"

namespace tn {
namespace {

Error resourceRefused(std::string reason) {
  return Error(std::string(sandbox::kSandboxErrorDomain), EPERM, std::move(reason));
}

// realpath(3) of path; a path holding NUL names nothing.
Result<std::string> resolvedPath(std::string_view path) {
  if (path.find('\0') != std::string_view::npos) return Error(std::string(sandbox::kSandboxErrorDomain), EINVAL);
  const std::unique_ptr<char, decltype(&std::free)> resolved(::realpath(std::string(path).c_str(), nullptr),
                                                             &std::free);
  if (!resolved) {
    const int error = errno;
    return Error(std::string(sandbox::kSandboxErrorDomain), error, fmt::format("{}: {}", path, std::strerror(error)));
  }
  return std::string(resolved.get());
}

// Why the name alone is refused, or "" when it may name something inside.
std::string lexicalRefusal(std::string_view resource) {
  if (resource.empty()) return "empty resource name";
  if (resource.find('\0') != std::string_view::npos) return "resource name holds NUL";
  if (resource.front() == '/') return "absolute resource name";
  size_t start = 0;
  while (start <= resource.size()) {
    const size_t end = std::min(resource.find('/', start), resource.size());
    if (resource.substr(start, end - start) == "..") return "resource name has a \"..\" component";
    start = end + 1;
  }
  return "";
}

bool isWithin(std::string_view path, std::string_view directory) {
  if (!path.starts_with(directory)) return false;
  return path.size() == directory.size() || directory.ends_with('/') || path[directory.size()] == '/';
}

}  // namespace

Result<std::string> bundleResourcePath(std::string_view bundlePath, std::string_view resource) {
  if (std::string reason = lexicalRefusal(resource); !reason.empty()) return resourceRefused(std::move(reason));
  Result<std::string> bundle = resolvedPath(bundlePath);
  if (!bundle) return bundle;
  std::string joined(bundlePath);
  if (!joined.ends_with('/')) joined += '/';
  joined += resource;
  Result<std::string> resolved = resolvedPath(joined);
  if (!resolved) return resolved;
  if (!isWithin(*resolved, *bundle)) {
    return resourceRefused(fmt::format("resource leaves the bundle (resolves to {})", *resolved));
  }
  return resolved;
}

Result<std::string> issueBundleResourceExtension(const URL& bundle, std::string_view resource) {
  Result<std::string> path = bundleResourcePath(bundle.path(), resource);
  if (!path) return path.error();
  return issueCheckedResourceExtension(*path);
}

Result<std::string> issueCheckedResourceExtension(std::string_view canonicalPath) {
  // Already canonical and checked: issued as it is, not resolved again.
  Result<std::string> token = sandbox::issueFileExtension(sandbox::kReadOnlyFileExtensionClass, canonicalPath, 0);
  if (token) TN_LOG_DEBUG(log::sandbox(), "issued file extension for {} -> {}", canonicalPath, *token);
  return token;
}

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
