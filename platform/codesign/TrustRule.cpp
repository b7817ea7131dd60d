#include "platform/codesign/TrustRule.h"

#include <fcntl.h>
#include <limits.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <optional>

#include <fmt/format.h>

namespace codesign {
namespace {

tn::Error untrusted(std::string reason) {
  return tn::Error(std::string(kCodesignErrorDomain), static_cast<int64_t>(CodesignErrorCode::Untrusted),
                   std::move(reason));
}

unsigned permissions(const struct stat& status) { return status.st_mode & 07777U; }

bool ownedByTrustedUser(const struct stat& status, uid_t trustedUser) {
  return status.st_uid == 0 || status.st_uid == trustedUser;
}

bool writableByOthers(const struct stat& status) { return (status.st_mode & (S_IWGRP | S_IWOTH)) != 0; }

// The path the open file really has, links resolved, as the kernel knows it.
std::optional<std::string> resolvedPathOf(int fd) {
  char target[PATH_MAX];
  const std::string link = fmt::format("/proc/self/fd/{}", fd);
  const ssize_t n = ::readlink(link.c_str(), target, sizeof target);
  if (n <= 0 || static_cast<size_t>(n) >= sizeof target || target[0] != '/') return std::nullopt;
  return std::string(target, static_cast<size_t>(n));
}

tn::Result<void> checkDirectory(const std::string& directory, uid_t trustedUser) {
  struct stat status {};
  if (::lstat(directory.c_str(), &status) != 0)
    return untrusted(fmt::format("directory {} cannot be examined: {}", directory, std::strerror(errno)));
  if (!S_ISDIR(status.st_mode)) return untrusted(fmt::format("{} is not a directory", directory));
  if (!ownedByTrustedUser(status, trustedUser))
    return untrusted(fmt::format("directory {} is owned by uid {}", directory, status.st_uid));
  if (writableByOthers(status) && (status.st_mode & S_ISVTX) == 0) {
    return untrusted(fmt::format("directory {} is writable by group or others and not sticky (mode {:04o})",
                                 directory, permissions(status)));
  }
  return {};
}

// Every directory above path, from its parent up to "/".
tn::Result<void> checkDirectoriesAbove(const std::string& path, uid_t trustedUser) {
  std::string directory = path;
  while (directory.size() > 1) {
    const size_t slash = directory.rfind('/');
    directory.resize(slash == 0 ? 1 : slash);
    tn::Result<void> checked = checkDirectory(directory, trustedUser);
    if (!checked) return checked;
  }
  return {};
}

}  // namespace

tn::Result<void> checkTrustedFile(int fd, uid_t trustedUser) {
  struct stat status {};
  if (::fstat(fd, &status) != 0) return untrusted(fmt::format("cannot be examined: {}", std::strerror(errno)));
  if (!S_ISREG(status.st_mode)) return untrusted("not a regular file");
  if (!ownedByTrustedUser(status, trustedUser))
    return untrusted(fmt::format("owned by uid {}, not by root or uid {}", status.st_uid, trustedUser));
  if (writableByOthers(status))
    return untrusted(fmt::format("writable by group or others (mode {:04o})", permissions(status)));
  const std::optional<std::string> resolved = resolvedPathOf(fd);
  if (!resolved) return untrusted("its location cannot be resolved");
  return checkDirectoriesAbove(*resolved, trustedUser);
}

tn::Result<void> checkTrustedPath(const std::string& path, uid_t trustedUser) {
  const int fd = ::open(path.c_str(), O_PATH | O_CLOEXEC);
  if (fd < 0) return untrusted(fmt::format("cannot be opened: {}", std::strerror(errno)));
  tn::Result<void> checked = checkTrustedFile(fd, trustedUser);
  ::close(fd);
  return checked;
}

}  // namespace codesign
