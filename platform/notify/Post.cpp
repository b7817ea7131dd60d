#include "platform/notify/Post.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <cstring>
#include <mutex>
#include <string>

#include <fmt/format.h>

#include "platform/notify/NotificationName.h"

namespace notify {
namespace {

constexpr mode_t kFileMode = 0644;
// A post writes the count as exactly this many decimal digits (zero-padded)
// and a newline, in one pwrite at offset 0, so the file's size never changes
// and a reader never sees a shorter or longer text than a writer wrote.
constexpr size_t kCounterDigits = 20;  // 18446744073709551615
constexpr size_t kCounterRecord = kCounterDigits + 1;
// What a reader reads: a record and a little room to tell a longer text apart.
constexpr size_t kCounterTextMax = 32;
// A reader reads until two reads agree (a pwrite that overlaps a pread may
// show a mix of two counts); past this many tries it takes the last one.
constexpr int kStableReadTries = 8;

tn::Error fileError(const std::string& path, std::string_view what, int error) {
  return notifyError(NotifyErrorCode::FileSystem, fmt::format("{}: {}: {}", path, what, std::strerror(error)));
}

// Closes the descriptor when it goes out of scope.
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

// Serialises this process's posts, so that posts from its threads each count
// exactly once. A process-private mutex: no other process can hold it.
std::mutex gPostMutex;

// Serialises the posts of one name across the poster's own processes: an
// exclusive flock on "<directory>/.<name>.lock", created with mode 0600. The
// lock is taken only when the file is a regular file of this user that
// nobody else may open, so no other user can hold it (flock needs an open
// descriptor). When it cannot be used (someone else's file, a name too long
// for the suffix) the post goes on without it: posts of several processes
// at the same instant may then merge.
class OwnerLock {
 public:
  explicit OwnerLock(std::string_view name) {
    const std::string path = fmt::format("{}/.{}.lock", notificationDirectory(), name);
    fd_ = ::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK, 0600);
    if (fd_ < 0) return;
    struct stat status {};
    const bool private_ = ::fstat(fd_, &status) == 0 && S_ISREG(status.st_mode) && status.st_uid == ::geteuid() &&
                          (status.st_mode & 077) == 0;
    int locked = -1;
    while (private_ && (locked = ::flock(fd_, LOCK_EX)) != 0 && errno == EINTR) {
    }
    if (locked != 0) {
      ::close(fd_);
      fd_ = -1;
    }
  }
  ~OwnerLock() {
    if (fd_ >= 0) ::close(fd_);  // releases the lock
  }
  OwnerLock(const OwnerLock&) = delete;
  OwnerLock& operator=(const OwnerLock&) = delete;

 private:
  int fd_ = -1;
};

// The count the text's first line holds: decimal digits (leading zeros
// allowed), ended by a newline or the end of the text. Anything else counts
// as zero.
uint64_t parseCounter(std::string_view text) {
  if (const size_t newline = text.find('\n'); newline != std::string_view::npos) text = text.substr(0, newline);
  uint64_t counter = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), counter);
  if (error != std::errc() || end != text.data() + text.size() || text.empty()) return 0;
  return counter;
}

tn::Result<std::string> readText(int fd, const std::string& path) {
  char buffer[kCounterTextMax];
  ssize_t n;
  do {
    n = ::pread(fd, buffer, sizeof buffer, 0);
  } while (n < 0 && errno == EINTR);
  if (n < 0) return fileError(path, "cannot read", errno);
  return std::string(buffer, static_cast<size_t>(n));
}

// Reads until two reads agree, without any lock: the writer's one pwrite
// and our preads may overlap, and a single read could show half of each.
tn::Result<uint64_t> readCounter(int fd, const std::string& path) {
  tn::Result<std::string> previous = readText(fd, path);
  if (!previous) return previous.error();
  for (int attempt = 1; attempt < kStableReadTries; ++attempt) {
    tn::Result<std::string> again = readText(fd, path);
    if (!again) return again.error();
    if (*again == *previous) break;
    previous = std::move(again);
  }
  return parseCounter(*previous);
}

tn::Result<void> writeCounter(int fd, uint64_t counter, const std::string& path) {
  const std::string text = fmt::format("{:0{}}\n", counter, kCounterDigits);
  ssize_t n;
  do {
    n = ::pwrite(fd, text.data(), text.size(), 0);
  } while (n < 0 && errno == EINTR);
  if (n < 0) return fileError(path, "cannot write", errno);
  if (static_cast<size_t>(n) != text.size()) return fileError(path, "cannot write", EIO);
  // A file longer than a record (an older format, or rewritten by hand) is
  // cut after the record; readers take the first line meanwhile.
  struct stat status {};
  if (::fstat(fd, &status) != 0) return fileError(path, "cannot examine", errno);
  if (static_cast<size_t>(status.st_size) > kCounterRecord &&
      ::ftruncate(fd, static_cast<off_t>(kCounterRecord)) != 0)
    return fileError(path, "cannot truncate", errno);
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
  const std::lock_guard serialised(gPostMutex);
  const OwnerLock acrossProcesses(name);
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
  return readCounter(fd.get(), path);
}

}  // namespace notify
