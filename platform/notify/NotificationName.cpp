#include "platform/notify/NotificationName.h"

#include "platform/paths/InstancePaths.h"

#include <sys/stat.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include <fmt/format.h>

namespace notify {
namespace {

constexpr size_t kNameMax = 255;
constexpr mode_t kDirectoryMode = 0755;

tn::Result<void> createDirectory(const std::string& path) {
  if (::mkdir(path.c_str(), kDirectoryMode) == 0) {
    if (::chmod(path.c_str(), kDirectoryMode) != 0) {
      return notifyError(NotifyErrorCode::FileSystem,
                         fmt::format("{}: cannot set mode: {}", path, std::strerror(errno)));
    }
    return {};
  }
  const int error = errno;
  struct stat status {};
  if (error == EEXIST && ::stat(path.c_str(), &status) == 0 && S_ISDIR(status.st_mode)) return {};
  return notifyError(NotifyErrorCode::FileSystem,
                     fmt::format("{}: cannot create directory: {}", path,
                                 std::strerror(error == EEXIST ? ENOTDIR : error)));
}

}  // namespace

tn::Error notifyError(NotifyErrorCode code, std::string message) {
  return tn::Error(std::string(kNotifyErrorDomain), static_cast<int64_t>(code), std::move(message));
}

tn::Result<void> validateNotificationName(std::string_view name) {
  const auto invalid = [&](std::string_view reason) {
    return notifyError(NotifyErrorCode::InvalidName, fmt::format("invalid notification name \"{}\": {}",
                                                                 name.substr(0, kNameMax), reason));
  };
  if (name.empty()) return invalid("empty");
  if (name == "." || name == "..") return invalid("not a file name");
  if (name.find('/') != std::string_view::npos) return invalid("contains \"/\"");
  if (name.find('\0') != std::string_view::npos) return invalid("contains NUL");
  if (name.size() > kNameMax) return invalid("longer than 255 bytes");
  return {};
}

std::string notificationDirectory() {
  return paths::currentLayout().notificationDirectory;
}

std::string notificationPath(std::string_view name) { return notificationDirectory() + "/" + std::string(name); }

tn::Result<void> createNotificationDirectory() {
  const std::string directory = notificationDirectory();
  for (size_t slash = directory.find('/', 1);; slash = directory.find('/', slash + 1)) {
    const std::string prefix = directory.substr(0, slash);
    if (!prefix.empty() && prefix.back() != '/') {
      tn::Result<void> created = createDirectory(prefix);
      if (!created) return created;
    }
    if (slash == std::string::npos) return {};
  }
}

}  // namespace notify
