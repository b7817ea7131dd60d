#pragma once

// InstallWatcher: notices changes under the application roots with inotify
// and tells its owner once things have settled.
//
// One inotify descriptor and one thread for any number of directories (an
// installation has thousands: each root, each application, its Support and
// Support/PlugIns directories and each plug-in bundle, so the one thread per
// directory of notify::DirectoryWatch does not fit here). The owner adds
// directories with watch() as it scans them; a watch goes away by itself
// when its directory does. Events are not interpreted: after the first
// event the thread waits until nothing has happened for the settle time
// (copies in progress make events in quick succession, at most 20 settle
// times in all) and then calls the callback once, on its own thread. The
// callback should only queue work.

#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <thread>

#include "platform/notify/InotifyChannel.h"
#include "platform/value/Result.h"

namespace registrar {

class InstallWatcher {
  struct CreateTag {
    explicit CreateTag() = default;
  };

 public:
  using Callback = std::function<void()>;

  static tn::Result<std::unique_ptr<InstallWatcher>> create(std::chrono::milliseconds settle, Callback callback);

  // Stops the thread; no callback runs after the destructor returns. Must
  // not be called from the callback.
  ~InstallWatcher();
  InstallWatcher(const InstallWatcher&) = delete;
  InstallWatcher& operator=(const InstallWatcher&) = delete;

  // Watches the directory at path (links followed) for entries created,
  // removed, renamed or written. Adding a directory twice is harmless.
  // False (logged at debug level) when it cannot be watched. Any thread.
  bool watch(const std::string& path);

  InstallWatcher(CreateTag, std::chrono::milliseconds settle, Callback callback,
                 std::unique_ptr<notify::InotifyChannel> channel);

 private:
  void run();

  const std::chrono::milliseconds settle_;
  const Callback callback_;
  const std::unique_ptr<notify::InotifyChannel> channel_;
  std::thread thread_;
};

}  // namespace registrar
