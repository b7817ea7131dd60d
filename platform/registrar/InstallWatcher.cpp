#include "platform/registrar/InstallWatcher.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/inotify.h>
#include <unistd.h>

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

tn::Error systemError(std::string_view what, int error) {
  return registrarError(RegistrarErrorCode::Store, fmt::format("{}: {}", what, std::strerror(error)));
}

}  // namespace

tn::Result<std::unique_ptr<InstallWatcher>> InstallWatcher::create(std::chrono::milliseconds settle,
                                                                   Callback callback) {
  const int inotify = ::inotify_init1(IN_CLOEXEC | IN_NONBLOCK);
  if (inotify < 0) return systemError("cannot create an inotify instance", errno);
  const int wakeup = ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  if (wakeup < 0) {
    const int error = errno;
    ::close(inotify);
    return systemError("cannot create an eventfd", error);
  }
  return std::make_unique<InstallWatcher>(CreateTag(), settle, std::move(callback), inotify, wakeup);
}

InstallWatcher::InstallWatcher(CreateTag, std::chrono::milliseconds settle, Callback callback, int inotify,
                               int wakeup)
    : settle_(settle), callback_(std::move(callback)), inotify_(inotify), wakeup_(wakeup) {
  thread_ = std::thread([this] { run(); });
}

InstallWatcher::~InstallWatcher() {
  const uint64_t one = 1;
  while (::write(wakeup_, &one, sizeof one) < 0 && errno == EINTR) {
  }
  thread_.join();
  ::close(inotify_);
  ::close(wakeup_);
}

bool InstallWatcher::watch(const std::string& path) {
  if (::inotify_add_watch(inotify_, path.c_str(), kWatchMask) >= 0) return true;
  TN_LOG_DEBUG(tn::log::rg(), "cannot watch {}: {}", path, std::strerror(errno));
  return false;
}

void InstallWatcher::run() {
  pollfd fds[2] = {{inotify_, POLLIN, 0}, {wakeup_, POLLIN, 0}};
  bool pending = false;  // events seen, callback not yet made
  std::chrono::steady_clock::time_point firstPending;
  for (;;) {
    if (pending && std::chrono::steady_clock::now() - firstPending >= settle_ * kMaxSettleRounds) {
      pending = false;
      callback_();
      continue;
    }
    const int timeout = pending ? static_cast<int>(settle_.count()) : -1;
    const int ready = ::poll(fds, 2, timeout);
    if (ready < 0) {
      if (errno == EINTR) continue;
      TN_LOG_ERROR(tn::log::rg(), "install watch stopped: poll: {}", std::strerror(errno));
      return;
    }
    if (fds[1].revents != 0) return;
    if (ready == 0) {  // quiet for the settle time
      pending = false;
      callback_();
      continue;
    }
    if (fds[0].revents != 0 && drainEvents() && !pending) {
      pending = true;
      firstPending = std::chrono::steady_clock::now();
    }
  }
}

bool InstallWatcher::drainEvents() {
  alignas(inotify_event) char buffer[16 * 1024];
  bool readAny = false;
  for (;;) {
    const ssize_t n = ::read(inotify_, buffer, sizeof buffer);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    readAny = true;
  }
  return readAny;
}

}  // namespace registrar
