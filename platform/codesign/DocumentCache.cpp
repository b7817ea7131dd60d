#include "platform/codesign/DocumentCache.h"

#include <sys/stat.h>

#include <cstdint>
#include <list>
#include <mutex>
#include <unordered_map>

#include "platform/bundle/ManifestFile.h"

namespace codesign {
namespace {

// What must be unchanged for a parsed result to be reused.
struct Stamp {
  dev_t device = 0;
  ino_t inode = 0;
  off_t size = 0;
  int64_t modified = 0;  // nanoseconds
  int64_t changed = 0;   // nanoseconds

  friend bool operator==(const Stamp&, const Stamp&) = default;
};

int64_t nanoseconds(const struct timespec& time) {
  return static_cast<int64_t>(time.tv_sec) * 1'000'000'000 + time.tv_nsec;
}

Stamp stampOf(const struct stat& status) {
  return Stamp{status.st_dev, status.st_ino, status.st_size, nanoseconds(status.st_mtim),
               nanoseconds(status.st_ctim)};
}

}  // namespace

struct DocumentCache::State {
  struct Entry {
    Stamp stamp;
    Parsed parsed;
    std::list<std::string>::iterator age;  // position in `order`
  };
  std::mutex mutex;
  std::unordered_map<std::string, Entry> entries;
  std::list<std::string> order;  // most recently used first
  std::size_t parses = 0;

  // Needs mutex.
  Parsed find(const std::string& path, const Stamp& stamp) {
    const auto it = entries.find(path);
    if (it == entries.end() || !(it->second.stamp == stamp)) return nullptr;
    order.splice(order.begin(), order, it->second.age);
    return it->second.parsed;
  }

  // Needs mutex.
  void store(const std::string& path, const Stamp& stamp, Parsed parsed) {
    if (const auto it = entries.find(path); it != entries.end()) {
      order.erase(it->second.age);
      entries.erase(it);
    }
    while (entries.size() >= kMaxEntries && !order.empty()) {
      entries.erase(order.back());
      order.pop_back();
    }
    order.push_front(path);
    entries.emplace(path, Entry{stamp, std::move(parsed), order.begin()});
  }
};

DocumentCache::DocumentCache() : state_(std::make_unique<State>()) {}
DocumentCache::~DocumentCache() = default;

DocumentCache& DocumentCache::shared() {
  static DocumentCache cache;
  return cache;
}

DocumentCache::Parsed DocumentCache::read(int fd, const std::string& path) {
  struct stat status {};
  if (::fstat(fd, &status) != 0 || !S_ISREG(status.st_mode)) {
    // Not cacheable; the reader names the reason.
    return std::make_shared<const tn::Result<tn::Value>>(bundle::readManifestDescriptor(fd, path));
  }
  const Stamp stamp = stampOf(status);
  {
    std::lock_guard lock(state_->mutex);
    if (Parsed parsed = state_->find(path, stamp)) return parsed;
    ++state_->parses;
  }
  // Parsed without the lock: one large document does not hold up readers of
  // the others. Two threads may both parse a file that changed; the later
  // store wins, and both results are right for the file they read.
  ::lseek(fd, 0, SEEK_SET);
  auto parsed = std::make_shared<const tn::Result<tn::Value>>(bundle::readManifestDescriptor(fd, path));
  struct stat after {};
  // A file written while it was read is not kept: its stamp no longer says
  // what was parsed.
  if (status.st_size <= kMaxCachedSize && ::fstat(fd, &after) == 0 && stampOf(after) == stamp) {
    std::lock_guard lock(state_->mutex);
    state_->store(path, stamp, parsed);
  }
  return parsed;
}

std::size_t DocumentCache::parseCount() const {
  std::lock_guard lock(state_->mutex);
  return state_->parses;
}

void DocumentCache::clear() {
  std::lock_guard lock(state_->mutex);
  state_->entries.clear();
  state_->order.clear();
}

}  // namespace codesign
