#include "platform/prefs/PreferenceDomain.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <mutex>
#include <unordered_set>
#include <utility>

#include <fmt/format.h>

#include "platform/value/AtomicFile.h"
#include "platform/value/Document.h"
#include "platform/paths/InstancePaths.h"

namespace prefs {
namespace {

tn::Error preferencesError(PreferencesErrorCode code, std::string message) {
  return tn::Error(std::string(kPreferencesErrorDomain), static_cast<int64_t>(code), std::move(message));
}

// Holds an exclusive flock on a lock file for its lifetime.
class WriterLock {
 public:
  explicit WriterLock(const std::string& path) : fd_(::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600)) {
    if (fd_ >= 0 && ::flock(fd_, LOCK_EX) != 0) {
      ::close(fd_);
      fd_ = -1;
    }
  }
  ~WriterLock() {
    if (fd_ >= 0) ::close(fd_);  // closing releases the lock
  }
  WriterLock(const WriterLock&) = delete;
  WriterLock& operator=(const WriterLock&) = delete;
  bool held() const { return fd_ >= 0; }

 private:
  int fd_;
};

// Directories whose stale temporary files this process removed already: a
// directory is cleaned the first time the process opens a domain in it.
// Bounded: past kMaxCleanedDirectories, reads stop cleaning (writers always
// clean).
constexpr size_t kMaxCleanedDirectories = 4096;

void removeStaleTemporariesOnce(const std::string& directory) {
  static std::mutex mutex;
  static std::unordered_set<std::string> cleaned;
  {
    const std::lock_guard lock(mutex);
    if (cleaned.size() >= kMaxCleanedDirectories || !cleaned.insert(directory).second) return;
  }
  (void)tn::removeStaleTemporaryFiles(directory);  // a missing directory has nothing to clean
}

}  // namespace

PreferenceDomain::PreferenceDomain(std::string name, uid_t uid) : name_(std::move(name)), uid_(uid) {}

PreferenceDomain::PreferenceDomain(std::string name) : PreferenceDomain(std::move(name), ::getuid()) {}

std::string PreferenceDomain::path() const {
  return fmt::format("{}/{}/{}.manifest", paths::currentLayout().preferencesDirectory, uid_, name_);
}

tn::Result<void> PreferenceDomain::checkName() const {
  if (name_.empty() || name_.find('/') != std::string::npos || name_.front() == '.') {
    return preferencesError(PreferencesErrorCode::InvalidDomain,
                            fmt::format("invalid preferences domain \"{}\"", name_));
  }
  return {};
}

tn::Result<tn::Dictionary> PreferenceDomain::values() const {
  if (auto valid = checkName(); !valid.ok()) return valid.error();
  const std::string file = path();
  removeStaleTemporariesOnce(std::filesystem::path(file).parent_path().string());
  struct stat status {};
  if (::stat(file.c_str(), &status) != 0 && (errno == ENOENT || errno == ENOTDIR)) return tn::Dictionary();
  tn::Result<tn::Value> document = tn::readDocumentFile(file);
  if (!document.ok()) {
    return preferencesError(PreferencesErrorCode::Unreadable, document.error().message().value_or(file));
  }
  if (!document->isDictionary()) {
    return preferencesError(PreferencesErrorCode::NotADictionary, file + ": the preferences are not a dictionary");
  }
  return *document->dictionary();
}

tn::Result<std::optional<tn::Value>> PreferenceDomain::value(std::string_view key) const {
  tn::Result<tn::Dictionary> all = values();
  if (!all.ok()) return all.error();
  const tn::Value* found = all->find(key);
  if (found == nullptr) return std::optional<tn::Value>();
  return std::optional<tn::Value>(*found);
}

tn::Result<void> PreferenceDomain::setValue(std::string_view key, const std::optional<tn::Value>& value) const {
  if (auto valid = checkName(); !valid.ok()) return valid.error();
  const std::filesystem::path file = path();
  std::error_code error;
  std::filesystem::create_directories(file.parent_path(), error);
  if (error) {
    return preferencesError(PreferencesErrorCode::WriteFailed,
                            fmt::format("{}: {}", file.parent_path().string(), error.message()));
  }
  ::chmod(file.parent_path().c_str(), 0700);
  const WriterLock lock(file.string() + ".lock");
  if (!lock.held()) {
    return preferencesError(PreferencesErrorCode::WriteFailed,
                            fmt::format("{}.lock: {}", file.string(), std::strerror(errno)));
  }
  // Saves of this domain that died left their temporary files; ours, under
  // the lock, is not made yet, and other domains' live writers keep theirs.
  (void)tn::removeStaleTemporaryFiles(file.parent_path().string());
  // A damaged file is replaced rather than kept: the write is the user's
  // newest intent.
  tn::Result<tn::Dictionary> existing = values();
  tn::Dictionary all = existing.ok() ? std::move(*existing) : tn::Dictionary();
  if (value) {
    all.set(std::string(key), *value);
  } else {
    all.erase(key);
  }
  tn::Result<std::string> text = tn::writeXmlDocument(tn::Value(std::move(all)));
  if (!text.ok()) return preferencesError(PreferencesErrorCode::WriteFailed, text.error().description());
  tn::Result<void> written = tn::writeFileAtomically(file.string(), *text, 0600);
  if (!written.ok()) return preferencesError(PreferencesErrorCode::WriteFailed, written.error().description());
  return {};
}

}  // namespace prefs
