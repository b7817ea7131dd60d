#include "platform/value/AtomicFile.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include <fmt/format.h>

namespace tn {
namespace {

Error fileError(const std::string& path, std::string_view what, int error) {
  return Error(std::string(kFileErrorDomain), error, fmt::format("{}: {}: {}", path, what, std::strerror(error)));
}

// The directory holding path ("." for a bare name) and the file name.
std::pair<std::string, std::string> splitPath(const std::string& path) {
  const size_t slash = path.rfind('/');
  if (slash == std::string::npos) return {".", path};
  return {slash == 0 ? "/" : path.substr(0, slash), path.substr(slash + 1)};
}

bool writeAll(int fd, std::string_view contents) {
  while (!contents.empty()) {
    const ssize_t n = ::write(fd, contents.data(), contents.size());
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return false;
    contents.remove_prefix(static_cast<size_t>(n));
  }
  return true;
}

Result<void> syncDirectory(const std::string& directory, const std::string& path) {
  const int fd = ::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (fd < 0) return fileError(path, "cannot open the directory to flush it", errno);
  const int result = ::fsync(fd);
  const int error = errno;
  ::close(fd);
  if (result != 0) return fileError(path, "cannot flush the directory", error);
  return {};
}

// An open temporary file that is removed unless it has been renamed.
class TemporaryFile {
 public:
  explicit TemporaryFile(std::string pathTemplate) : path_(std::move(pathTemplate)) {
    fd_ = ::mkostemp(path_.data(), O_CLOEXEC);
  }
  ~TemporaryFile() {
    if (fd_ >= 0) ::close(fd_);
    if (!renamed_ && fd_ != kNeverCreated) ::unlink(path_.c_str());
  }
  TemporaryFile(const TemporaryFile&) = delete;
  TemporaryFile& operator=(const TemporaryFile&) = delete;

  bool created() const { return fd_ >= 0; }
  int fd() const { return fd_; }
  const std::string& path() const { return path_; }

  // Closes the descriptor; answers whether close reported success (it can
  // report a deferred write error).
  bool close() {
    const int result = ::close(fd_);
    fd_ = kClosed;
    return result == 0;
  }
  bool renameTo(const std::string& target) {
    renamed_ = ::rename(path_.c_str(), target.c_str()) == 0;
    return renamed_;
  }

 private:
  static constexpr int kNeverCreated = -1;  // what mkostemp returns on failure
  static constexpr int kClosed = -2;

  std::string path_;
  int fd_;
  bool renamed_ = false;
};

}  // namespace

Result<void> writeFileAtomically(const std::string& path, std::string_view contents, mode_t mode) {
  const auto [directory, name] = splitPath(path);
  if (name.empty()) return fileError(path, "not a file path", EISDIR);
  TemporaryFile temporary(fmt::format("{}/.{}.tmp-XXXXXX", directory, name));
  if (!temporary.created()) return fileError(path, "cannot create a temporary file", errno);
  if (::fchmod(temporary.fd(), mode) != 0) return fileError(path, "cannot set the mode", errno);
  if (!writeAll(temporary.fd(), contents)) return fileError(path, "cannot write", errno);
  if (::fsync(temporary.fd()) != 0) return fileError(path, "cannot flush", errno);
  if (!temporary.close()) return fileError(path, "cannot write", errno);
  if (!temporary.renameTo(path)) return fileError(path, "cannot replace the file", errno);
  return syncDirectory(directory, path);
}

}  // namespace tn
