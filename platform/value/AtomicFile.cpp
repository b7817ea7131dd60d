#include "platform/value/AtomicFile.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <optional>

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

// An open temporary file that is removed unless it has been renamed. It is
// locked (flock, exclusive) for as long as it is open, which tells
// removeStaleTemporaryFiles that its writer is alive. Only its owner (and
// root) can open it (mkostemp makes it 0600), so no other user can take the
// lock first.
class TemporaryFile {
 public:
  explicit TemporaryFile(std::string pathTemplate) : path_(std::move(pathTemplate)) {
    fd_ = ::mkostemp(path_.data(), O_CLOEXEC);
  }
  ~TemporaryFile() {
    if (fd_ >= 0) ::close(fd_);
    if (!renamed_ && !lost_ && fd_ != kNeverCreated) ::unlink(path_.c_str());
  }
  TemporaryFile(const TemporaryFile&) = delete;
  TemporaryFile& operator=(const TemporaryFile&) = delete;

  bool created() const { return fd_ >= 0; }
  int fd() const { return fd_; }
  const std::string& path() const { return path_; }

  // Takes the lock and checks the name still leads to this file: a cleaner
  // that locked it between mkostemp and here took it for a dead writer's
  // and removed it (or is about to). False then; the caller tries a new one.
  bool lock() {
    if (::flock(fd_, LOCK_EX | LOCK_NB) != 0) {
      lost_ = true;
      return false;
    }
    struct stat opened {};
    struct stat named {};
    if (::fstat(fd_, &opened) != 0 || ::lstat(path_.c_str(), &named) != 0 || opened.st_dev != named.st_dev ||
        opened.st_ino != named.st_ino) {
      lost_ = true;
      return false;
    }
    return true;
  }

  // Closes the descriptor, releasing the lock.
  void close() {
    ::close(fd_);
    fd_ = kClosed;
  }
  bool renameTo(const std::string& target) {
    renamed_ = ::rename(path_.c_str(), target.c_str()) == 0;
    return renamed_;
  }
  // Gives the file the name target as well, unless target exists (link()
  // never replaces a name); the temporary name goes with the object.
  bool linkTo(const std::string& target) { return ::link(path_.c_str(), target.c_str()) == 0; }

 private:
  static constexpr int kNeverCreated = -1;  // what mkostemp returns on failure
  static constexpr int kClosed = -2;

  std::string path_;
  int fd_;
  bool renamed_ = false;
  bool lost_ = false;  // a cleaner removed the name; not ours to unlink
};

// How often a writer makes a new temporary file when cleaners keep taking
// its fresh ones (each loss needs a cleaner to run in that instant).
constexpr int kTemporaryAttempts = 8;

std::string temporaryTemplate(const std::string& directory, const std::string& name) {
  return fmt::format("{}/.{}{}XXXXXX", directory, name, kTemporaryMarker);
}

// Whether a directory entry is named like a temporary file of
// writeFileAtomically: ".<name>.tenon-tmp.XXXXXX", six characters of
// mkostemp's alphabet at the end.
bool isTemporaryName(std::string_view entry) {
  constexpr size_t kRandom = 6;
  if (entry.size() < 1 + 1 + kTemporaryMarker.size() + kRandom || entry.front() != '.') return false;
  const std::string_view random = entry.substr(entry.size() - kRandom);
  if (!std::all_of(random.begin(), random.end(), [](char c) { return std::isalnum(static_cast<unsigned char>(c)); }))
    return false;
  return entry.substr(entry.size() - kRandom - kTemporaryMarker.size(), kTemporaryMarker.size()) == kTemporaryMarker;
}

// Removes the temporary file entry of directory fd when its writer is gone:
// a regular file (links are not followed) whose lock we get at once, still
// under its name. True when removed.
bool removeIfStale(int directory, const char* entry) {
  const int fd = ::openat(directory, entry, O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY);
  if (fd < 0) return false;
  bool removed = false;
  struct stat opened {};
  struct stat named {};
  if (::fstat(fd, &opened) == 0 && S_ISREG(opened.st_mode) && ::flock(fd, LOCK_EX | LOCK_NB) == 0 &&
      ::fstatat(directory, entry, &named, AT_SYMLINK_NOFOLLOW) == 0 && named.st_dev == opened.st_dev &&
      named.st_ino == opened.st_ino) {
    removed = ::unlinkat(directory, entry, 0) == 0;
  }
  ::close(fd);  // releases the lock
  return removed;
}

enum class Placing { Replace, CreateOnly };

// Fills, flushes and puts a locked temporary file at path: renamed over it,
// or linked to it when nothing is there yet.
Result<void> writeThrough(TemporaryFile& temporary, const std::string& path, const std::string& directory,
                          std::string_view contents, mode_t mode, Placing placing) {
  if (::fchmod(temporary.fd(), mode) != 0) return fileError(path, "cannot set the mode", errno);
  if (!writeAll(temporary.fd(), contents)) return fileError(path, "cannot write", errno);
  if (::fsync(temporary.fd()) != 0) return fileError(path, "cannot flush", errno);
  // Placed while still open, so still locked: a cleaner must not take it
  // for a dead writer's between close and rename. close cannot report a
  // write error any more once fsync succeeded.
  if (placing == Placing::Replace && !temporary.renameTo(path)) {
    return fileError(path, "cannot replace the file", errno);
  }
  if (placing == Placing::CreateOnly && !temporary.linkTo(path)) {
    return fileError(path, errno == EEXIST ? "already exists" : "cannot create the file", errno);
  }
  temporary.close();
  return syncDirectory(directory, path);
}

Result<void> writeFile(const std::string& path, std::string_view contents, mode_t mode, Placing placing) {
  const auto [directory, name] = splitPath(path);
  if (name.empty()) return fileError(path, "not a file path", EISDIR);
  std::optional<TemporaryFile> temporary;
  for (int attempt = 0; attempt < kTemporaryAttempts; ++attempt) {
    temporary.emplace(temporaryTemplate(directory, name));
    if (!temporary->created()) return fileError(path, "cannot create a temporary file", errno);
    if (temporary->lock()) break;
    temporary.reset();
  }
  if (!temporary) return fileError(path, "cannot keep a temporary file", EBUSY);
  return writeThrough(*temporary, path, directory, contents, mode, placing);
}

}  // namespace

Result<void> writeFileAtomically(const std::string& path, std::string_view contents, mode_t mode) {
  return writeFile(path, contents, mode, Placing::Replace);
}

Result<void> createFileAtomically(const std::string& path, std::string_view contents, mode_t mode) {
  return writeFile(path, contents, mode, Placing::CreateOnly);
}

Result<size_t> removeStaleTemporaryFiles(const std::string& directory) {
  const int fd = ::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (fd < 0) return fileError(directory, "cannot open the directory", errno);
  DIR* listing = ::fdopendir(fd);
  if (listing == nullptr) {
    const int error = errno;
    ::close(fd);
    return fileError(directory, "cannot list the directory", error);
  }
  size_t removed = 0;
  while (const dirent* entry = ::readdir(listing)) {
    if (isTemporaryName(entry->d_name) && removeIfStale(fd, entry->d_name)) ++removed;
  }
  ::closedir(listing);  // closes fd too
  return removed;
}

}  // namespace tn
