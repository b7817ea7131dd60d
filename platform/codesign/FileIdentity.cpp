#include "platform/codesign/FileIdentity.h"

#include <sys/stat.h>

namespace codesign {
namespace {

FileIdentity identityOf(const struct stat& status) { return FileIdentity{status.st_dev, status.st_ino}; }

}  // namespace

std::optional<FileIdentity> fileIdentityOf(int fd) {
  struct stat status {};
  if (fd < 0 || ::fstat(fd, &status) != 0) return std::nullopt;
  return identityOf(status);
}

std::optional<FileIdentity> fileIdentityAt(const std::string& path) {
  struct stat status {};
  if (path.empty() || ::stat(path.c_str(), &status) != 0) return std::nullopt;
  return identityOf(status);
}

}  // namespace codesign
