#include "platform/sandbox/Extensions.h"

#include <climits>
#include <cstdlib>
#include <cstring>
#include <map>
#include <mutex>

#include <fmt/format.h>

namespace sandbox {
namespace {

tn::Error sandboxError(int code, std::string message) {
  return tn::Error(std::string(kSandboxErrorDomain), code, std::move(message));
}

// The grants this process holds, by handle. Handles count up from 1.
struct HeldExtensions {
  std::mutex mutex;
  int64_t nextHandle = 1;                   // guarded by mutex
  std::map<int64_t, ExtensionGrant> grants;  // guarded by mutex
};

HeldExtensions& held() {
  static HeldExtensions* table = new HeldExtensions;  // never destroyed: used until exit
  return *table;
}

tn::Result<std::string> canonicalPath(std::string_view path) {
  const std::string copy(path);
  char resolved[PATH_MAX];
  if (::realpath(copy.c_str(), resolved) == nullptr) {
    const int error = errno;
    return sandboxError(error, fmt::format("{}: {}", copy, std::strerror(error)));
  }
  return std::string(resolved);
}

tn::Result<std::string> signedToken(ExtensionKind kind, std::string_view extensionClass, std::string_view subject) {
  tn::Result<SandboxKey> key = loadOrCreateSandboxKey();
  if (!key) return key.error();
  return makeExtensionToken(kind, extensionClass, subject, *key);
}

bool hasNul(std::string_view text) { return text.find('\0') != std::string_view::npos; }

// Whether path is directory or lies below it.
bool isWithin(std::string_view path, std::string_view directory) {
  if (!path.starts_with(directory)) return false;
  return path.size() == directory.size() || directory.ends_with('/') || path[directory.size()] == '/';
}

}  // namespace

tn::Result<std::string> issueFileExtension(std::string_view extensionClass, std::string_view path, uint32_t flags) {
  if (extensionClass.empty() || hasNul(extensionClass)) return sandboxError(EINVAL, "invalid extension class");
  if (path.empty() || path.front() != '/' || hasNul(path)) {
    return sandboxError(EINVAL, fmt::format("not an absolute path: {}", path));
  }
  if ((flags & ~kCanonicalPath) != 0) return sandboxError(EINVAL, "unknown flags");
  if ((flags & kCanonicalPath) == 0) return signedToken(ExtensionKind::File, extensionClass, path);
  tn::Result<std::string> resolved = canonicalPath(path);
  if (!resolved) return resolved;
  return signedToken(ExtensionKind::File, extensionClass, *resolved);
}

tn::Result<std::string> issueServiceExtension(std::string_view extensionClass, std::string_view serviceName,
                                              uint32_t flags) {
  if (extensionClass.empty() || hasNul(extensionClass)) return sandboxError(EINVAL, "invalid extension class");
  if (serviceName.empty() || hasNul(serviceName)) return sandboxError(EINVAL, "invalid service name");
  if (flags != 0) return sandboxError(EINVAL, "unknown flags");
  return signedToken(ExtensionKind::Service, extensionClass, serviceName);
}

tn::Result<int64_t> consumeExtension(std::string_view text) {
  tn::Result<ExtensionToken> token = parseExtensionToken(text);
  if (!token) return token.error();
  tn::Result<SandboxKey> key = readSandboxKey();
  if (key) {
    if (!hasValidSignature(*token, *key)) return sandboxError(EPERM, "extension token not signed by this machine");
  } else if (key.error().code() == ENOENT) {
    return sandboxError(ENOKEY, "no sandbox key on this machine: " + key.error().localizedDescription());
  } else if (key.error().code() != EACCES && key.error().code() != EPERM) {
    return key.error();
  }
  HeldExtensions& table = held();
  const std::lock_guard lock(table.mutex);
  const int64_t handle = table.nextHandle++;
  table.grants.emplace(handle, ExtensionGrant{token->kind, std::move(token->extensionClass), std::move(token->subject)});
  return handle;
}

tn::Result<void> releaseExtension(int64_t handle) {
  HeldExtensions& table = held();
  const std::lock_guard lock(table.mutex);
  if (table.grants.erase(handle) == 0) return sandboxError(EBADF, fmt::format("no extension with handle {}", handle));
  return {};
}

std::optional<ExtensionGrant> heldExtension(int64_t handle) {
  HeldExtensions& table = held();
  const std::lock_guard lock(table.mutex);
  const auto found = table.grants.find(handle);
  if (found == table.grants.end()) return std::nullopt;
  return found->second;
}

bool holdsFileExtension(std::string_view path) {
  HeldExtensions& table = held();
  const std::lock_guard lock(table.mutex);
  for (const auto& [handle, grant] : table.grants) {
    if (grant.kind == ExtensionKind::File && isWithin(path, grant.subject)) return true;
  }
  return false;
}

bool holdsServiceExtension(std::string_view serviceName) {
  HeldExtensions& table = held();
  const std::lock_guard lock(table.mutex);
  for (const auto& [handle, grant] : table.grants) {
    if (grant.kind == ExtensionKind::Service && grant.subject == serviceName) return true;
  }
  return false;
}

}  // namespace sandbox
