#include "platform/notify/InotifyChannel.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include <fmt/format.h>

#include "platform/notify/NotificationName.h"

namespace notify {

tn::Result<std::unique_ptr<InotifyChannel>> InotifyChannel::open() {
  const int inotify = ::inotify_init1(IN_CLOEXEC | IN_NONBLOCK);
  if (inotify < 0) {
    return notifyError(NotifyErrorCode::FileSystem,
                       fmt::format("cannot create an inotify instance: {}", std::strerror(errno)));
  }
  const int wakeup = ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  if (wakeup < 0) {
    const int error = errno;
    ::close(inotify);
    return notifyError(NotifyErrorCode::FileSystem, fmt::format("cannot create an eventfd: {}", std::strerror(error)));
  }
  return std::make_unique<InotifyChannel>(CreateTag(), inotify, wakeup);
}

InotifyChannel::InotifyChannel(CreateTag, int inotify, int wakeup) : inotify_(inotify), wakeup_(wakeup) {}

InotifyChannel::~InotifyChannel() {
  ::close(inotify_);
  ::close(wakeup_);
}

int InotifyChannel::addWatch(const std::string& path, uint32_t mask) {
  return ::inotify_add_watch(inotify_, path.c_str(), mask);
}

void InotifyChannel::wake() {
  const uint64_t one = 1;
  while (::write(wakeup_, &one, sizeof one) < 0 && errno == EINTR) {
  }
}

InotifyChannel::Wait InotifyChannel::wait(int timeoutMilliseconds) {
  pollfd fds[2] = {{inotify_, POLLIN, 0}, {wakeup_, POLLIN, 0}};
  for (;;) {
    const int ready = ::poll(fds, 2, timeoutMilliseconds);
    if (ready < 0 && errno == EINTR) continue;
    if (ready < 0) return Wait::Failed;
    if (fds[1].revents != 0) return Wait::Woken;
    if (ready == 0) return Wait::Timeout;
    return Wait::Events;
  }
}

bool InotifyChannel::drain(const EventHandler& each) {
  return drainWatched([&](int, uint32_t mask, std::string_view name) { each(mask, name); });
}

bool InotifyChannel::drainWatched(const WatchEventHandler& each) {
  alignas(inotify_event) char buffer[16 * 1024];
  bool readAny = false;
  for (;;) {
    const ssize_t n = ::read(inotify_, buffer, sizeof buffer);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    readAny = true;
    for (size_t offset = 0; offset < static_cast<size_t>(n);) {
      inotify_event event;
      std::memcpy(&event, buffer + offset, sizeof event);
      const char* name = buffer + offset + sizeof event;
      each(event.wd, event.mask, std::string_view(name, event.len > 0 ? ::strnlen(name, event.len) : 0));
      offset += sizeof event + event.len;
    }
  }
  return readAny;
}

}  // namespace notify
