#include "platform/notify/DirectoryWatch.h"

#include <sys/inotify.h>

#include <cerrno>
#include <cstring>

#include <fmt/format.h>

#include "platform/log/Log.h"
#include "platform/notify/NotificationName.h"

namespace notify {
namespace {

constexpr uint32_t kWatchMask = IN_MODIFY | IN_CLOSE_WRITE | IN_CREATE | IN_DELETE | IN_MOVED_FROM |
                                IN_MOVED_TO | IN_ATTRIB | IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR;

}  // namespace

tn::Result<std::unique_ptr<DirectoryWatch>> DirectoryWatch::create(const std::string& directory, Callback callback) {
  if (!callback) return notifyError(NotifyErrorCode::InvalidArgument, "a directory watch needs a callback");
  tn::Result<std::unique_ptr<InotifyChannel>> channel = InotifyChannel::open();
  if (!channel) return channel.error();
  if ((*channel)->addWatch(directory, kWatchMask) < 0) {
    return notifyError(NotifyErrorCode::FileSystem, fmt::format("{}: cannot watch: {}", directory, std::strerror(errno)));
  }
  return std::make_unique<DirectoryWatch>(CreateTag(), directory, std::move(callback), std::move(*channel));
}

DirectoryWatch::DirectoryWatch(CreateTag, std::string directory, Callback callback,
                               std::unique_ptr<InotifyChannel> channel)
    : directory_(std::move(directory)), callback_(std::move(callback)), channel_(std::move(channel)) {
  thread_ = std::thread([this] { run(); });
}

DirectoryWatch::~DirectoryWatch() {
  channel_->wake();
  thread_.join();
}

void DirectoryWatch::run() {
  bool gone = false;  // the directory went away and the callback was told
  for (;;) {
    switch (channel_->wait(-1)) {
      case InotifyChannel::Wait::Woken:
        return;
      case InotifyChannel::Wait::Failed:
        TN_LOG_ERROR(tn::log::ops(), "watch of {} stopped: poll: {}", directory_, std::strerror(errno));
        return;
      case InotifyChannel::Wait::Timeout:
      case InotifyChannel::Wait::Events:
        break;
    }
    DirectoryChanges changes;
    const bool readAny = channel_->drain([&](uint32_t mask, std::string_view name) {
      if ((mask & IN_Q_OVERFLOW) != 0) changes.overflow = true;
      if ((mask & (IN_IGNORED | IN_DELETE_SELF | IN_MOVE_SELF)) != 0) changes.directoryGone = true;
      if (!name.empty()) changes.names.emplace(name);
    });
    if (!readAny) continue;
    if (gone) continue;  // nothing more to tell; wait for the owner's wake
    if (!changes.names.empty() || changes.overflow || changes.directoryGone) callback_(changes);
    // The thread stays until the owner wakes it: a thread that ended by
    // itself would wait unjoined for as long as its owner lives.
    gone = changes.directoryGone;
  }
}

}  // namespace notify
