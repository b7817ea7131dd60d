#include "platform/registrar/InstallWatcher.h"

#include <sys/inotify.h>

#include <cerrno>
#include <cstring>

#include <fmt/format.h>

#include "platform/log/Log.h"
#include "platform/registrar/Store.h"

namespace registrar {
namespace {

constexpr uint32_t kWatchMask = IN_CLOSE_WRITE | IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO | IN_ATTRIB |
                                IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR;

// Events that never stop (a file rewritten in a loop) still get a callback
// after this many settle times.
constexpr int kMaxSettleRounds = 20;

}  // namespace

tn::Result<std::unique_ptr<InstallWatcher>> InstallWatcher::create(std::chrono::milliseconds settle,
                                                                   Callback callback) {
  tn::Result<std::unique_ptr<notify::InotifyChannel>> channel = notify::InotifyChannel::open();
  if (!channel) return registrarError(RegistrarErrorCode::Store, channel.error().message().value_or(""));
  return std::make_unique<InstallWatcher>(CreateTag(), settle, std::move(callback), std::move(*channel));
}

InstallWatcher::InstallWatcher(CreateTag, std::chrono::milliseconds settle, Callback callback,
                               std::unique_ptr<notify::InotifyChannel> channel)
    : settle_(settle), callback_(std::move(callback)), channel_(std::move(channel)) {
  thread_ = std::thread([this] { run(); });
}

InstallWatcher::~InstallWatcher() {
  channel_->wake();
  thread_.join();
}

bool InstallWatcher::watch(const std::string& path) {
  if (channel_->addWatch(path, kWatchMask) >= 0) return true;
  TN_LOG_DEBUG(tn::log::rg(), "cannot watch {}: {}", path, std::strerror(errno));
  return false;
}

void InstallWatcher::run() {
  bool pending = false;  // events seen, callback not yet made
  std::chrono::steady_clock::time_point firstPending;
  for (;;) {
    if (pending && std::chrono::steady_clock::now() - firstPending >= settle_ * kMaxSettleRounds) {
      pending = false;
      callback_();
      continue;
    }
    const int timeout = pending ? static_cast<int>(settle_.count()) : -1;
    switch (channel_->wait(timeout)) {
      case notify::InotifyChannel::Wait::Woken:
        return;
      case notify::InotifyChannel::Wait::Failed:
        TN_LOG_ERROR(tn::log::rg(), "install watch stopped: poll: {}", std::strerror(errno));
        return;
      case notify::InotifyChannel::Wait::Timeout:  // quiet for the settle time
        pending = false;
        callback_();
        continue;
      case notify::InotifyChannel::Wait::Events:
        break;
    }
    if (channel_->drain([](uint32_t, std::string_view) {}) && !pending) {
      pending = true;
      firstPending = std::chrono::steady_clock::now();
    }
  }
}

}  // namespace registrar
