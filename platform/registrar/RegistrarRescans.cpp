// The registrar's scans that no caller asked for by name: the first scan
// of an empty store, the background verification of a warm start, and the
// rescans of the applications the install watcher saw change.

#include <sys/stat.h>

#include <chrono>
#include <filesystem>

#include "platform/dispatch/ThreadPool.h"
#include "platform/log/Log.h"
#include "platform/registrar/ChangeScope.h"
#include "platform/registrar/InstallWatcher.h"
#include "platform/registrar/Registrar.h"
#include "platform/registrar/RegistrarState.h"
#include "platform/registrar/Scanner.h"

namespace registrar {

// A scan the caller waits for, reporting its progress in the log every
// second: a first start reads every bundle, which takes a while.
tn::Result<ScanSummary> Registrar::firstScan() {
  using Clock = std::chrono::steady_clock;
  const Clock::time_point started = Clock::now();
  Clock::time_point lastLine = started;
  TN_LOG_DEFAULT(tn::log::rg(), "scanning the application roots");
  tn::Result<ScanSummary> scanned = scan([&](size_t done, size_t total) {
    const Clock::time_point now = Clock::now();
    if (now - lastLine < std::chrono::seconds(1)) return;
    lastLine = now;
    TN_LOG_DEFAULT(tn::log::rg(), "scanning the application roots: {} of {} applications read", done, total);
  });
  if (!scanned) return scanned;
  const auto elapsed = std::chrono::duration_cast<std::chrono::milliseconds>(Clock::now() - started);
  TN_LOG_DEFAULT(tn::log::rg(), "scanned the application roots in {} ms: {} applications, {} plug-ins, {} skipped",
                 elapsed.count(), scanned->applications, scanned->plugIns, scanned->skipped);
  return scanned;
}

void Registrar::startWatching() {
  // A root that does not exist cannot be watched, and an application copied
  // into it later would go unnoticed until the next scan: the watching
  // registrar makes its roots.
  for (const std::string& root : paths_.applicationRoots) {
    std::error_code error;
    std::filesystem::create_directories(root, error);
    if (error) TN_LOG_ERROR(tn::log::rg(), "cannot create the application root {}: {}", root, error.message());
  }
  std::weak_ptr<Registrar> weakSelf = weak_from_this();
  tn::Result<std::unique_ptr<InstallWatcher>> watcher =
      InstallWatcher::create(
          options_.settle, [paths = paths_](const std::string& path) { return ChangeScope::groupOf(path, paths); },
          [weakSelf](WatchedChanges changes) {
        // Never release the last reference on the watcher's own thread (the
        // destructor joins it): hand it to the registrar queue.
        if (std::shared_ptr<Registrar> self = weakSelf.lock()) {
          const std::shared_ptr<tn::dispatch::SerialQueue> queue = self->queue_;
          self->scheduleRescan(ChangeScope::of(changes, self->paths_, *self->state()));
          queue->async([self = std::move(self)] {});
        }
      });
  if (!watcher) {
    TN_LOG_ERROR(tn::log::rg(), "not watching the application roots: {}", watcher.error());
    return;
  }
  watcher_ = std::move(*watcher);
}

void Registrar::scheduleRescan(const ChangeScope& scope) {
  if (scope.empty()) return;
  {
    const std::lock_guard lock(pendingMutex_);
    const bool queued = !pendingScope_->empty();
    pendingScope_->merge(scope);
    if (queued) return;  // the block queued before takes this scope too
  }
  std::weak_ptr<Registrar> weakSelf = weak_from_this();
  queue_->async([weakSelf] {
    if (const std::shared_ptr<Registrar> self = weakSelf.lock()) self->runPendingRescan();
  });
}

void Registrar::runPendingRescan() {
  queue_->assertOnQueue();
  ChangeScope scope;
  {
    const std::lock_guard lock(pendingMutex_);
    scope = std::exchange(*pendingScope_, ChangeScope());
  }
  if (scope.empty()) return;
  using Clock = std::chrono::steady_clock;
  const Clock::time_point started = Clock::now();
  tn::Result<ScanSummary> scanned = rescanOnQueue(scope);
  if (!scanned) {
    TN_LOG_ERROR(tn::log::rg(), "rescan failed: {}", scanned.error());
    return;
  }
  const auto elapsed = std::chrono::duration_cast<std::chrono::microseconds>(Clock::now() - started);
  TN_LOG_INFO(tn::log::rg(), "rescanned {} (looked at {}, read {} bundles) in {} us: {} installed, {} uninstalled",
              scanned->incremental ? "the changed applications" : "everything", scanned->examined, scanned->read,
              elapsed.count(), scanned->installed, scanned->uninstalled);
}

// Rescans only what scope names, keeping the facts of everything else.
tn::Result<ScanSummary> Registrar::rescanOnQueue(const ChangeScope& scope) {
  if (scope.everything) return scanOnQueue({});
  // Reading bundles takes milliseconds: requests must not wait for it to
  // notice their sockets.
  tn::dispatch::ThreadPool::willRunLongTask();
  Scanner scanner(*state(), paths_, watcher_.get(), true);
  scanner.startFrom(scope.applications, scope.registered, scope.extensionPoints);
  for (const std::string& app : scope.applications) {
    struct stat info {};
    if (::lstat(app.c_str(), &info) == 0) scanner.scanApplication(app);  // else it is gone
  }
  scanner.scanRegistered(scope.registered);
  if (scope.extensionPoints) scanner.scanExtensionPoints();
  tn::Result<ScanSummary> summary = commit(scanner.plan);
  if (!summary) {
    if (summary.error().code() != static_cast<int64_t>(RegistrarErrorCode::StaleKnowledge)) return summary;
    return scanOnQueue({});  // another process wrote the store: start from its contents
  }
  summary->examined = scanner.examined;
  summary->read = scanner.read;
  summary->incremental = true;
  const std::lock_guard lock(stateMutex_);
  lastScan_ = *summary;
  return summary;
}

ScanSummary Registrar::lastScan() const {
  const std::lock_guard lock(stateMutex_);
  return lastScan_;
}

}  // namespace registrar
