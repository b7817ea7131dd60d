#include "platform/notify/Post.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <cstring>
#include <string>

#include <fmt/format.h>

#include "platform/notify/NotificationName.h"

namespace notify {
namespace {

constexpr mode_t kFileMode = 0644;
// "18446744073709551615\n" and a little room to tell a longer text apart.
constexpr size_t kCounterTextMax = 32;

tn::Error fileError(const std::string& path, std::string_view what, int error) {
  return notifyError(NotifyErrorCode::FileSystem, fmt::format("{}: {}: {}", path, what, std::strerror(error)));
}

// Closes the descriptor (and so releases its lock) when it goes out of scope.
class Descriptor {
 public:
  explicit Descriptor(int fd) : fd_(fd) {}
  ~Descriptor() {
    if (fd_ >= 0) ::close(fd_);
  }
  Descriptor(const Descriptor&) = delete;
  Descriptor& operator=(const Descriptor&) = delete;
  int get() const { return fd_; }

 private:
  int fd_;
};

tn::Result<void> lock(int fd, int operation, const std::string& path) {
  while (::flock(fd, operation) != 0) {
    if (errno != EINTR) return fileError(path, "cannot lock", errno);
  }
  return {};
}

// The count the text holds: decimal digits, optionally ended by a newline.
// Anything else counts as zero.
uint64_t parseCounter(std::string_view text) {
  if (text.ends_with('\n')) text.remove_suffix(1);
  uint64_t counter = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), counter);
  if (error != std::errc() || end != text.data() + text.size() || text.empty()) return 0;
  return counter;
}

tn::Result<uint64_t> readCounter(int fd, const std::string& path) {
  char buffer[kCounterTextMax];
  ssize_t n;
  do {
    n = ::pread(fd, buffer, sizeof buffer, 0);
  } while (n < 0 && errno == EINTR);
  if (n < 0) return fileError(path, "cannot read", errno);
  return parseCounter(std::string_view(buffer, static_cast<size_t>(n)));
}

tn::Result<void> writeCounter(int fd, uint64_t counter, const std::string& path) {
  const std::string text = fmt::format("{}\n", counter);
  ssize_t n;
  do {
    n = ::pwrite(fd, text.data(), text.size(), 0);
  } while (n < 0 && errno == EINTR);
  if (n < 0) return fileError(path, "cannot write", errno);
  if (static_cast<size_t>(n) != text.size()) return fileError(path, "cannot write", EIO);
  if (::ftruncate(fd, static_cast<off_t>(text.size())) != 0) return fileError(path, "cannot truncate", errno);
  return {};
}

tn::Result<void> requireRegularFile(int fd, const std::string& path) {
  struct stat status {};
  if (::fstat(fd, &status) != 0) return fileError(path, "cannot examine", errno);
  if (!S_ISREG(status.st_mode)) return fileError(path, "not a regular file", EINVAL);
  return {};
}

// Opens the file of a notification for posting, creating it with exactly
// kFileMode when it is new. Never follows a link, never blocks on a FIFO.
tn::Result<int> openForPosting(const std::string& path) {
  constexpr int kFlags = O_RDWR | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK;
  int fd = ::open(path.c_str(), kFlags | O_CREAT | O_EXCL, kFileMode);
  if (fd >= 0) {
    if (::fchmod(fd, kFileMode) != 0) {
      const int error = errno;
      ::close(fd);
      return fileError(path, "cannot set mode", error);
    }
    return fd;
  }
  if (errno != EEXIST) return fileError(path, "cannot create", errno);
  fd = ::open(path.c_str(), kFlags);
  if (fd < 0) return fileError(path, "cannot open", errno);
  return fd;
}

}  // namespace

tn::Result<uint64_t> post(std::string_view name) {
  if (tn::Result<void> valid = validateNotificationName(name); !valid) return valid.error();
  if (tn::Result<void> created = createNotificationDirectory(); !created) return created.error();
  const std::string path = notificationPath(name);
  tn::Result<int> opened = openForPosting(path);
  if (!opened) return opened.error();
  const Descriptor fd(*opened);
  if (tn::Result<void> regular = requireRegularFile(fd.get(), path); !regular) return regular.error();
  if (tn::Result<void> locked = lock(fd.get(), LOCK_EX, path); !locked) return locked.error();
  tn::Result<uint64_t> counter = readCounter(fd.get(), path);
  if (!counter) return counter;
  const uint64_t next = *counter + 1;
  if (tn::Result<void> written = writeCounter(fd.get(), next, path); !written) return written.error();
  return next;
}

tn::Result<uint64_t> postCount(std::string_view name) {
  if (tn::Result<void> valid = validateNotificationName(name); !valid) return valid.error();
  const std::string path = notificationPath(name);
  const Descriptor fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK));
  if (fd.get() < 0) {
    if (errno == ENOENT) return uint64_t{0};
    return fileError(path, "cannot open", errno);
  }
  if (tn::Result<void> regular = requireRegularFile(fd.get(), path); !regular) return regular.error();
  if (tn::Result<void> locked = lock(fd.get(), LOCK_SH, path); !locked) return locked.error();
  return readCounter(fd.get(), path);
}

}  // namespace notify
