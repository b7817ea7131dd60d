#include "platform/notify/DirectoryWatch.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include <fmt/format.h>

#include "platform/log/Log.h"
#include "platform/notify/NotificationName.h"

namespace notify {
namespace {

constexpr uint32_t kWatchMask = IN_MODIFY | IN_CLOSE_WRITE | IN_CREATE | IN_DELETE | IN_MOVED_FROM |
                                IN_MOVED_TO | IN_ATTRIB | IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR;

tn::Error systemError(std::string_view what, int error) {
  return notifyError(NotifyErrorCode::FileSystem, fmt::format("{}: {}", what, std::strerror(error)));
}

}  // namespace

tn::Result<std::unique_ptr<DirectoryWatch>> DirectoryWatch::create(const std::string& directory, Callback callback) {
  if (!callback) return notifyError(NotifyErrorCode::InvalidArgument, "a directory watch needs a callback");
  const int inotify = ::inotify_init1(IN_CLOEXEC | IN_NONBLOCK);
  if (inotify < 0) return systemError("cannot create an inotify instance", errno);
  if (::inotify_add_watch(inotify, directory.c_str(), kWatchMask) < 0) {
    const int error = errno;
    ::close(inotify);
    return systemError(fmt::format("{}: cannot watch", directory), error);
  }
  const int wakeup = ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  if (wakeup < 0) {
    const int error = errno;
    ::close(inotify);
    return systemError("cannot create an eventfd", error);
  }
  return std::make_unique<DirectoryWatch>(CreateTag(), directory, std::move(callback), inotify, wakeup);
}

DirectoryWatch::DirectoryWatch(CreateTag, std::string directory, Callback callback, int inotify, int wakeup)
    : directory_(std::move(directory)), callback_(std::move(callback)), inotify_(inotify), wakeup_(wakeup) {
  thread_ = std::thread([this] { run(); });
}

DirectoryWatch::~DirectoryWatch() {
  const uint64_t one = 1;
  while (::write(wakeup_, &one, sizeof one) < 0 && errno == EINTR) {
  }
  thread_.join();
  ::close(inotify_);
  ::close(wakeup_);
}

void DirectoryWatch::run() {
  pollfd fds[2] = {{inotify_, POLLIN, 0}, {wakeup_, POLLIN, 0}};
  for (;;) {
    if (::poll(fds, 2, -1) < 0) {
      if (errno == EINTR) continue;
      TN_LOG_ERROR(tn::log::ops(), "watch of {} stopped: poll: {}", directory_, std::strerror(errno));
      return;
    }
    if (fds[1].revents != 0) return;
    if (fds[0].revents == 0) continue;
    DirectoryChanges changes;
    if (!readEvents(changes)) continue;
    if (!changes.names.empty() || changes.overflow || changes.directoryGone) callback_(changes);
    if (changes.directoryGone) return;
  }
}

bool DirectoryWatch::readEvents(DirectoryChanges& into) {
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
      if ((event.mask & IN_Q_OVERFLOW) != 0) into.overflow = true;
      if ((event.mask & (IN_IGNORED | IN_DELETE_SELF | IN_MOVE_SELF)) != 0) into.directoryGone = true;
      if (event.len > 0) into.names.emplace(name, ::strnlen(name, event.len));
      offset += sizeof event + event.len;
    }
  }
  return readAny;
}

}  // namespace notify
