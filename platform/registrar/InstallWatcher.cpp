#include "platform/registrar/InstallWatcher.h"

#include <dirent.h>
#include <sys/inotify.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>

#include <fmt/format.h>

#include "platform/log/Log.h"
#include "platform/registrar/Store.h"

namespace registrar {
namespace {

constexpr uint32_t kWatchMask = IN_CLOSE_WRITE | IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO | IN_ATTRIB |
                                IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR;

// Directories created under a watched one are followed this deep (a plug-in
// nests its own plug-ins four levels down, each Support/PlugIns/<bundle>).
constexpr int kMaxCreatedDepth = 16;

using Clock = std::chrono::steady_clock;

bool isRegularFile(const std::string& path) {
  struct stat info {};
  return ::lstat(path.c_str(), &info) == 0 && S_ISREG(info.st_mode);
}

}  // namespace

// Events of one group since it was last handed over.
struct InstallWatcher::Group {
  std::set<std::string> paths;
  std::set<std::string> writing;  // regular files created and not yet closed
  bool complete = true;           // renames and removals only
  Clock::time_point first;
  Clock::time_point last;
};

tn::Result<std::unique_ptr<InstallWatcher>> InstallWatcher::create(std::chrono::milliseconds settle, GroupOf groupOf,
                                                                   Callback callback) {
  tn::Result<std::unique_ptr<notify::InotifyChannel>> channel = notify::InotifyChannel::open();
  if (!channel) return registrarError(RegistrarErrorCode::Store, channel.error().message().value_or(""));
  return std::make_unique<InstallWatcher>(CreateTag(), settle, std::move(groupOf), std::move(callback),
                                          std::move(*channel));
}

InstallWatcher::InstallWatcher(CreateTag, std::chrono::milliseconds settle, GroupOf groupOf, Callback callback,
                               std::unique_ptr<notify::InotifyChannel> channel)
    : settle_(settle), groupOf_(std::move(groupOf)), callback_(std::move(callback)), channel_(std::move(channel)) {
  thread_ = std::thread([this] { run(); });
}

InstallWatcher::~InstallWatcher() {
  channel_->wake();
  thread_.join();
}

bool InstallWatcher::watch(const std::string& path) {
  const int watch = channel_->addWatch(path, kWatchMask);
  if (watch < 0) {
    TN_LOG_DEBUG(tn::log::rg(), "cannot watch {}: {}", path, std::strerror(errno));
    return false;
  }
  const std::lock_guard lock(watchesMutex_);
  pathByWatch_[watch] = path;
  return true;
}

std::string InstallWatcher::pathOfWatch(int watch) {
  const std::lock_guard lock(watchesMutex_);
  const auto found = pathByWatch_.find(watch);
  return found != pathByWatch_.end() ? found->second : std::string();
}

// A directory made under a watched one is watched before anything is
// copied into it, when possible; what was already made in it is watched too.
void InstallWatcher::watchCreatedTree(const std::string& path, int depth) {
  if (depth > kMaxCreatedDepth || !watch(path)) return;
  DIR* stream = ::opendir(path.c_str());
  if (stream == nullptr) return;
  while (const dirent* entry = ::readdir(stream)) {
    const std::string_view name = entry->d_name;
    if (name == "." || name == "..") continue;
    if (entry->d_type == DT_DIR) watchCreatedTree(path + "/" + std::string(name), depth + 1);
  }
  ::closedir(stream);
}

void InstallWatcher::take(Groups& groups, bool& overflowed, int watch, uint32_t mask, std::string_view name) {
  if (watch < 0 || (mask & IN_Q_OVERFLOW) != 0) {
    overflowed = true;
    return;
  }
  if ((mask & IN_IGNORED) != 0) {
    const std::lock_guard lock(watchesMutex_);
    pathByWatch_.erase(watch);
    return;
  }
  const std::string base = pathOfWatch(watch);
  if (base.empty()) return;  // a watch already forgotten
  const std::string path = name.empty() ? base : base + "/" + std::string(name);
  const auto [found, fresh] = groups.try_emplace(groupOf_(path));
  Group& group = found->second;
  const Clock::time_point now = Clock::now();
  if (fresh) group.first = now;
  group.last = now;
  if ((mask & IN_CREATE) != 0) {
    group.complete = false;
    if ((mask & IN_ISDIR) != 0) {
      watchCreatedTree(path, 0);
    } else if (isRegularFile(path)) {
      group.writing.insert(path);
    }
  }
  if ((mask & (IN_CLOSE_WRITE | IN_ATTRIB)) != 0) group.complete = false;
  if ((mask & (IN_CLOSE_WRITE | IN_DELETE | IN_MOVED_FROM)) != 0) group.writing.erase(path);
  group.paths.insert(path);
}

int InstallWatcher::deliverReady(Groups& groups) {
  const Clock::time_point now = Clock::now();
  WatchedChanges ready;
  Clock::time_point next = Clock::time_point::max();
  for (auto it = groups.begin(); it != groups.end();) {
    Group& group = it->second;
    const bool quiet = group.writing.empty() && now - group.last >= settle_;
    if (group.complete || quiet || now - group.first >= kMaxPendingTime) {
      ready.paths.merge(group.paths);
      it = groups.erase(it);
      continue;
    }
    const Clock::time_point due = group.writing.empty() ? std::min(group.last + settle_, group.first + kMaxPendingTime)
                                                        : group.first + kMaxPendingTime;
    next = std::min(next, due);
    ++it;
  }
  if (!ready.paths.empty()) callback_(std::move(ready));
  if (next == Clock::time_point::max()) return -1;
  const auto wait = std::chrono::ceil<std::chrono::milliseconds>(next - Clock::now()).count();
  return static_cast<int>(std::max<int64_t>(wait, 0));
}

void InstallWatcher::run() {
  Groups groups;
  for (;;) {
    const int timeout = deliverReady(groups);
    switch (channel_->wait(timeout)) {
      case notify::InotifyChannel::Wait::Woken:
        return;
      case notify::InotifyChannel::Wait::Failed:
        TN_LOG_ERROR(tn::log::rg(), "install watch stopped: poll: {}", std::strerror(errno));
        return;
      case notify::InotifyChannel::Wait::Timeout:
        continue;
      case notify::InotifyChannel::Wait::Events:
        break;
    }
    bool overflowed = false;
    channel_->drainWatched([&](int watch, uint32_t mask, std::string_view name) {
      take(groups, overflowed, watch, mask, name);
    });
    if (overflowed) {
      // Events were lost: whatever was pending, the owner looks at everything.
      groups.clear();
      WatchedChanges everything;
      everything.overflowed = true;
      callback_(std::move(everything));
    }
  }
}

}  // namespace registrar
