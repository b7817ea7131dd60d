#include "platform/types/TypeWatcher.h"

#include <sys/inotify.h>

#include <cerrno>
#include <cstring>
#include <filesystem>

#include "platform/log/Log.h"

namespace types {
namespace {

constexpr uint32_t kWatchMask = IN_CLOSE_WRITE | IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO | IN_ATTRIB |
                                IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR;
// A burst that never settles still reloads after this many rounds.
constexpr int kMaxSettleRounds = 40;

bool isSourceName(std::string_view name) {
  return name == "subclasses" || name == "aliases" || name == "mime" || name == "tenon" || name == "types" ||
         name.ends_with(".manifest");
}

}  // namespace

tn::Result<std::unique_ptr<TypeWatcher>> TypeWatcher::create(const TypePaths& paths, std::function<void()> changed) {
  tn::Result<std::unique_ptr<notify::InotifyChannel>> channel = notify::InotifyChannel::open();
  if (!channel.ok()) return channel.error();
  return std::make_unique<TypeWatcher>(CreateTag(), paths, std::move(changed), std::move(*channel));
}

TypeWatcher::TypeWatcher(CreateTag, TypePaths paths, std::function<void()> changed,
                         std::unique_ptr<notify::InotifyChannel> channel)
    : paths_(std::move(paths)), changed_(std::move(changed)), channel_(std::move(channel)) {
  addWatches();
  thread_ = std::thread([this] { run(); });
}

TypeWatcher::~TypeWatcher() {
  channel_->wake();
  thread_.join();
}

void TypeWatcher::addWatches() {
  std::vector<std::filesystem::path> directories;
  for (const std::string& mime : paths_.mimeDirectories) directories.emplace_back(mime);
  directories.emplace_back(paths_.declarationsDirectory);
  for (const std::filesystem::path& directory : directories) {
    // Watching one that does not exist (yet) fails harmlessly; its parent's
    // watch sees it appear.
    channel_->addWatch(directory.string(), kWatchMask);
    channel_->addWatch(directory.parent_path().string(), kWatchMask);
  }
}

bool TypeWatcher::drainRelevant() {
  bool relevant = false;
  channel_->drain([&](uint32_t mask, std::string_view name) {
    if ((mask & (IN_Q_OVERFLOW | IN_DELETE_SELF | IN_MOVE_SELF)) != 0 || isSourceName(name)) relevant = true;
  });
  return relevant;
}

void TypeWatcher::run() {
  for (;;) {
    switch (channel_->wait(-1)) {
      case notify::InotifyChannel::Wait::Woken:
        return;
      case notify::InotifyChannel::Wait::Failed:
        TN_LOG_ERROR(tn::log::ops(), "type hierarchy watch stopped: poll: {}", std::strerror(errno));
        return;
      case notify::InotifyChannel::Wait::Timeout:
      case notify::InotifyChannel::Wait::Events:
        break;
    }
    bool relevant = drainRelevant();
    for (int round = 0; round < kMaxSettleRounds; ++round) {
      const auto waited = channel_->wait(static_cast<int>(kSettle.count()));
      if (waited == notify::InotifyChannel::Wait::Woken) return;
      if (waited != notify::InotifyChannel::Wait::Events) break;
      relevant = drainRelevant() || relevant;
    }
    if (!relevant) continue;
    addWatches();
    changed_();
  }
}

}  // namespace types
