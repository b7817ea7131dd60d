#include "platform/types/TypeHierarchy.h"

#include <utility>

#include "platform/log/Log.h"
#include "platform/types/TypeWatcher.h"

namespace types {
namespace {

// Stamps are unique across every hierarchy of the process, so one
// per-thread cache serves them all: a stamp seen for one hierarchy is never
// taken for another's.
std::atomic<uint64_t> nextStamp{1};

struct ThreadCache {
  uint64_t stamp = 0;
  std::shared_ptr<const TypeTable> table;
};

thread_local ThreadCache threadCache;

// Problems are logged, but a broken installation must not flood the log.
constexpr size_t kMaxLoggedProblems = 20;

}  // namespace

TypeHierarchy::TypeHierarchy(TypePaths paths) : paths_(std::move(paths)) { reload(); }

TypeHierarchy::~TypeHierarchy() {
  std::unique_ptr<TypeWatcher> watcher;
  {
    const std::lock_guard lock(watchMutex_);
    watcher = std::move(watcher_);
  }
  watcher.reset();  // joins the watcher's thread outside the lock
}

TypeHierarchy& TypeHierarchy::system() {
  static TypeHierarchy* const hierarchy = [] {
    auto* made = new TypeHierarchy(TypePaths::fromEnvironment());
    if (tn::Result<void> watching = made->watch(); !watching.ok()) {
      TN_LOG_ERROR(tn::log::ops(), "type hierarchy changes are not followed: {}",
                   watching.error().localizedDescription());
    }
    return made;
  }();
  return *hierarchy;
}

std::shared_ptr<const TypeTable> TypeHierarchy::snapshot() const {
  const uint64_t stamp = stamp_.load(std::memory_order_acquire);
  ThreadCache& cache = threadCache;
  if (cache.stamp == stamp) return cache.table;
  const std::lock_guard lock(publishMutex_);
  cache.stamp = stamp_.load(std::memory_order_relaxed);
  cache.table = table_;
  return cache.table;
}

void TypeHierarchy::publish(std::shared_ptr<const TypeTable> table) {
  const std::lock_guard lock(publishMutex_);
  table_ = std::move(table);
  stamp_.store(nextStamp.fetch_add(1), std::memory_order_release);
  loads_.fetch_add(1);
}

void TypeHierarchy::reload() {
  const std::lock_guard lock(reloadMutex_);
  std::shared_ptr<const TypeTable> table = loadTypeTable(paths_);
  const std::vector<std::string>& problems = table->problems();
  for (size_t i = 0; i < problems.size() && i < kMaxLoggedProblems; ++i) {
    TN_LOG_ERROR(tn::log::ops(), "type hierarchy: {}", problems[i]);
  }
  if (problems.size() > kMaxLoggedProblems) {
    TN_LOG_ERROR(tn::log::ops(), "type hierarchy: {} more problems", problems.size() - kMaxLoggedProblems);
  }
  TN_LOG_INFO(tn::log::ops(), "type hierarchy loaded: {} types, {} problems", table->size(), problems.size());
  publish(std::move(table));
}

tn::Result<void> TypeHierarchy::watch() {
  const std::lock_guard lock(watchMutex_);
  if (watcher_) return {};
  tn::Result<std::unique_ptr<TypeWatcher>> watcher = TypeWatcher::create(paths_, [this] { reload(); });
  if (!watcher.ok()) return watcher.error();
  watcher_ = std::move(*watcher);
  return {};
}

}  // namespace types
