#include "platform/relay/ServicePath.h"

#include <sys/stat.h>
#include <sys/un.h>

#include <cerrno>
#include <cstdlib>

#include <fmt/format.h>

#include "platform/relay/RelayError.h"
#include "platform/paths/InstancePaths.h"

namespace relay {
namespace {

tn::Error invalidName(std::string_view serviceName, std::string_view why) {
  return makeRelayError(RelayErrorCode::InvalidServiceName,
                        fmt::format("invalid service name \"{}\": {}", serviceName, why));
}

tn::Result<void> createDirectory(const std::string& path, unsigned mode) {
  if (::mkdir(path.c_str(), static_cast<mode_t>(mode)) != 0) {
    if (errno == EEXIST) return {};
    return makeSystemError(fmt::format("mkdir {}", path), errno);
  }
  // mkdir applied the umask; the mode is part of the contract.
  if (::chmod(path.c_str(), static_cast<mode_t>(mode)) != 0) {
    return makeSystemError(fmt::format("chmod {}", path), errno);
  }
  return {};
}

}  // namespace

tn::Result<void> validateServiceName(std::string_view serviceName) {
  if (serviceName.empty()) return invalidName(serviceName, "empty");
  if (serviceName == "." || serviceName == "..") return invalidName(serviceName, "not a file name");
  if (serviceName.find('/') != std::string_view::npos) return invalidName(serviceName, "contains '/'");
  if (serviceName.find('\0') != std::string_view::npos) return invalidName(serviceName, "contains NUL");
  const std::size_t pathLength = relayDirectory().size() + 1 + serviceName.size();
  if (pathLength >= sizeof(sockaddr_un::sun_path)) {
    return invalidName(serviceName, fmt::format("socket path of {} bytes is too long", pathLength));
  }
  return {};
}

std::string relayDirectory() { return paths::currentLayout().relayDirectory; }

tn::Result<std::string> servicePath(std::string_view serviceName) {
  if (tn::Result<void> valid = validateServiceName(serviceName); !valid.ok()) return valid.error();
  return fmt::format("{}/{}", relayDirectory(), serviceName);
}

tn::Result<void> createDirectories(const std::string& path, unsigned mode) {
  for (std::size_t slash = path.find('/', 1); slash != std::string::npos;
       slash = path.find('/', slash + 1)) {
    if (tn::Result<void> made = createDirectory(path.substr(0, slash), mode); !made.ok()) return made;
  }
  return createDirectory(path, mode);
}

}  // namespace relay
