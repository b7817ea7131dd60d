#include "platform/notify/Observer.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include <fmt/format.h>

#include "platform/log/Log.h"
#include "platform/notify/NotificationName.h"
#include "platform/notify/Post.h"

namespace notify {
namespace {

constexpr uint32_t kWatchMask = IN_MODIFY | IN_CLOSE_WRITE | IN_CREATE | IN_DELETE | IN_MOVED_FROM |
                                IN_MOVED_TO | IN_DELETE_SELF | IN_ONLYDIR;

tn::Error systemError(std::string_view what, int error) {
  return notifyError(NotifyErrorCode::FileSystem, fmt::format("{}: {}", what, std::strerror(error)));
}

}  // namespace

tn::Result<std::unique_ptr<Observer>> Observer::create(std::string_view name,
                                                       std::shared_ptr<tn::dispatch::SerialQueue> queue,
                                                       std::function<void()> handler) {
  if (tn::Result<void> valid = validateNotificationName(name); !valid) return valid.error();
  if (!queue || !handler) {
    return notifyError(NotifyErrorCode::InvalidArgument, "an observer needs a queue and a handler");
  }
  if (tn::Result<void> created = createNotificationDirectory(); !created) return created.error();

  const int inotify = ::inotify_init1(IN_CLOEXEC | IN_NONBLOCK);
  if (inotify < 0) return systemError("cannot create an inotify instance", errno);
  const std::string directory = notificationDirectory();
  if (::inotify_add_watch(inotify, directory.c_str(), kWatchMask) < 0) {
    const int error = errno;
    ::close(inotify);
    return systemError(fmt::format("{}: cannot watch", directory), error);
  }
  // The count is read after the watch is in place, so no post falls between.
  tn::Result<uint64_t> count = postCount(name);
  if (!count) {
    ::close(inotify);
    return count.error();
  }
  const int wakeup = ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  if (wakeup < 0) {
    const int error = errno;
    ::close(inotify);
    return systemError("cannot create an eventfd", error);
  }
  return std::make_unique<Observer>(CreateTag(), std::string(name), std::move(queue), std::move(handler),
                                    inotify, wakeup, *count);
}

Observer::Observer(CreateTag, std::string name, std::shared_ptr<tn::dispatch::SerialQueue> queue,
                   std::function<void()> handler, int inotify, int wakeup, uint64_t count)
    : name_(std::move(name)),
      queue_(std::move(queue)),
      delivery_(std::make_shared<Delivery>()),
      inotify_(inotify),
      wakeup_(wakeup),
      seen_(count) {
  delivery_->handler = std::move(handler);
  thread_ = std::thread([this] { watch(); });
}

Observer::~Observer() {
  const uint64_t one = 1;
  while (::write(wakeup_, &one, sizeof one) < 0 && errno == EINTR) {
  }
  thread_.join();
  delivery_->cancelled.store(true);
  // Blocks queued before this point now skip the handler; wait for one that
  // may be running it, unless that is our caller.
  if (!queue_->isCurrent()) queue_->sync([] {});
  ::close(inotify_);
  ::close(wakeup_);
}

void Observer::watch() {
  pollfd fds[2] = {{inotify_, POLLIN, 0}, {wakeup_, POLLIN, 0}};
  for (;;) {
    if (::poll(fds, 2, -1) < 0) {
      if (errno == EINTR) continue;
      TN_LOG_ERROR(tn::log::ops(), "notification observer for {} stopped: poll: {}", name_, std::strerror(errno));
      return;
    }
    if (fds[1].revents != 0) return;
    if (fds[0].revents != 0 && !drainEvents()) {
      TN_LOG_ERROR(tn::log::ops(), "notification observer for {} stopped: {} is gone", name_,
                   notificationDirectory());
      return;
    }
  }
}

bool Observer::drainEvents() {
  alignas(inotify_event) char buffer[16 * 1024];
  bool changed = false;
  bool watchGone = false;
  for (;;) {
    const ssize_t n = ::read(inotify_, buffer, sizeof buffer);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    for (size_t offset = 0; offset < static_cast<size_t>(n);) {
      inotify_event event;
      std::memcpy(&event, buffer + offset, sizeof event);
      const char* eventName = buffer + offset + sizeof event;
      if ((event.mask & IN_Q_OVERFLOW) != 0) changed = true;
      if ((event.mask & (IN_IGNORED | IN_DELETE_SELF)) != 0) watchGone = true;
      if (event.len > 0 && name_ == std::string_view(eventName, ::strnlen(eventName, event.len))) changed = true;
      offset += sizeof event + event.len;
    }
  }
  if (changed || watchGone) deliverNewPosts();
  return !watchGone;
}

void Observer::deliverNewPosts() {
  const tn::Result<uint64_t> count = postCount(name_);
  if (!count) {
    TN_LOG_ERROR(tn::log::ops(), "notification observer for {}: {}", name_, count.error().description());
    return;
  }
  if (*count < seen_) seen_ = 0;  // the file was removed and started over
  const uint64_t pending = std::min(*count - seen_, kMaxBurst);
  seen_ = *count;
  for (uint64_t i = 0; i < pending; ++i) {
    queue_->async([delivery = delivery_] {
      if (!delivery->cancelled.load()) delivery->handler();
    });
  }
}

}  // namespace notify
