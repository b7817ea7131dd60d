#include "platform/bundle/ManifestFile.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include <fmt/format.h>

#include "platform/value/Document.h"

namespace bundle {
namespace {

tn::Error documentError(tn::DocumentErrorCode code, std::string message) {
  return tn::Error(std::string(tn::kDocumentErrorDomain), static_cast<int64_t>(code), std::move(message));
}

tn::Error unreadable(const std::string& path, std::string_view reason) {
  return documentError(tn::DocumentErrorCode::Unreadable, fmt::format("{}: cannot read: {}", path, reason));
}

tn::Error tooLarge(const std::string& path, uint64_t size) {
  return documentError(tn::DocumentErrorCode::TooLarge,
                       fmt::format("{}: too large: {} bytes (the limit is {})", path, size,
                                   tn::kMaxDocumentSize));
}

// Reads fd to its end, refusing more than the document size limit even when
// the file grows while it is read.
tn::Result<std::string> readBytes(int fd, const std::string& path, uint64_t sizeHint) {
  std::string bytes;
  bytes.reserve(static_cast<size_t>(sizeHint));
  char buffer[65536];
  for (;;) {
    const ssize_t n = ::read(fd, buffer, sizeof buffer);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return unreadable(path, std::strerror(errno));
    if (n == 0) return bytes;
    bytes.append(buffer, static_cast<size_t>(n));
    if (bytes.size() > tn::kMaxDocumentSize) return tooLarge(path, bytes.size());
  }
}

}  // namespace

int openManifestFile(const std::string& path) {
  return ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY);
}

tn::Result<tn::Value> readManifestDescriptor(int fd, const std::string& path) {
  struct stat status {};
  if (::fstat(fd, &status) != 0) return unreadable(path, std::strerror(errno));
  if (!S_ISREG(status.st_mode)) return unreadable(path, "not a regular file");
  const auto size = static_cast<uint64_t>(status.st_size);
  if (size > tn::kMaxDocumentSize) return tooLarge(path, size);
  tn::Result<std::string> bytes = readBytes(fd, path, size);
  if (!bytes) return bytes.error();
  return tn::readDocument(*bytes, path);
}

tn::Result<tn::Value> readManifestFile(const std::string& path) {
  const int fd = openManifestFile(path);
  if (fd < 0) return unreadable(path, std::strerror(errno));
  tn::Result<tn::Value> value = readManifestDescriptor(fd, path);
  ::close(fd);
  return value;
}

}  // namespace bundle
