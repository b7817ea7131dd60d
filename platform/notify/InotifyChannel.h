#pragma once

// InotifyChannel: an inotify descriptor paired with an eventfd, for the
// watcher threads of this system (DirectoryWatch here, the registrar's
// install watcher). The thread waits on both; its owner wakes it to stop.
//
//   auto channel = notify::InotifyChannel::open();           // Result
//   (*channel)->addWatch("/some/dir", IN_CREATE | IN_DELETE);
//   while ((*channel)->wait(-1) == InotifyChannel::Wait::Events)
//     (*channel)->drain([](uint32_t mask, std::string_view name) { ... });
//   // elsewhere: (*channel)->wake();  then join the thread

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>

#include "platform/value/Result.h"

namespace notify {

class InotifyChannel {
  struct CreateTag {
    explicit CreateTag() = default;
  };

 public:
  // Errors: FileSystem (inotify or eventfd could not be made).
  static tn::Result<std::unique_ptr<InotifyChannel>> open();
  ~InotifyChannel();  // closes both descriptors
  InotifyChannel(const InotifyChannel&) = delete;
  InotifyChannel& operator=(const InotifyChannel&) = delete;

  // inotify_add_watch; -1 with errno set on failure. Any thread.
  int addWatch(const std::string& path, uint32_t mask);

  // Makes the waiting thread's wait() answer Woken, now and from then on.
  // Any thread.
  void wake();

  enum class Wait { Events, Woken, Timeout, Failed };
  // Waits up to timeoutMilliseconds (-1: no limit) for events or a wake.
  // Failed (errno set) when poll itself failed.
  Wait wait(int timeoutMilliseconds);

  // Reads every event pending now and hands each to `each` with its mask
  // and the name of the entry (empty for the watched directory itself).
  // True when anything was read.
  using EventHandler = std::function<void(uint32_t mask, std::string_view name)>;
  bool drain(const EventHandler& each);
  // The same with the watch descriptor each event came from (-1 for a
  // queue overflow, IN_Q_OVERFLOW), for owners of many watches.
  using WatchEventHandler = std::function<void(int watch, uint32_t mask, std::string_view name)>;
  bool drainWatched(const WatchEventHandler& each);

  InotifyChannel(CreateTag, int inotify, int wakeup);

 private:
  const int inotify_;
  const int wakeup_;
};

}  // namespace notify
