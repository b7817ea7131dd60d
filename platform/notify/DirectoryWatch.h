#pragma once

// DirectoryWatch: tells its owner when entries of one directory change.
//
//   auto watch = notify::DirectoryWatch::create("/etc", [](const DirectoryChanges& changes) {
//     if (changes.touches("locale.conf")) ...
//   });
//
// One inotify descriptor and one thread per watch; the callback runs on that
// thread, once per batch of events read together, so it should be short
// (typically: queue work elsewhere). Creation, modification, removal and
// renames of entries count, and so does an overflow of the kernel's event
// queue (then every name may have changed). When the directory itself goes
// away the callback is told (`directoryGone`) once, and no more calls come.

#include <functional>
#include <memory>
#include <set>
#include <string>
#include <string_view>
#include <thread>

#include "platform/notify/InotifyChannel.h"
#include "platform/value/Result.h"

namespace notify {

struct DirectoryChanges {
  std::set<std::string> names;  // entries that changed
  bool overflow = false;        // events were lost: assume anything changed
  bool directoryGone = false;   // the watched directory was removed; last call

  // True when `name` may have changed.
  bool touches(std::string_view name) const { return overflow || names.count(std::string(name)) != 0; }
};

class DirectoryWatch {
  struct CreateTag {
    explicit CreateTag() = default;
  };

 public:
  using Callback = std::function<void(const DirectoryChanges&)>;

  // Watches `directory`, which must exist. Errors: FileSystem (inotify or
  // the directory), InvalidArgument (no callback).
  static tn::Result<std::unique_ptr<DirectoryWatch>> create(const std::string& directory, Callback callback);

  // Stops the thread; no callback runs after the destructor returns. Must
  // not be called from the callback.
  ~DirectoryWatch();
  DirectoryWatch(const DirectoryWatch&) = delete;
  DirectoryWatch& operator=(const DirectoryWatch&) = delete;

  const std::string& directory() const { return directory_; }

  // Use create().
  DirectoryWatch(CreateTag, std::string directory, Callback callback, std::unique_ptr<InotifyChannel> channel);

 private:
  void run();  // the thread's loop

  const std::string directory_;
  const Callback callback_;
  const std::unique_ptr<InotifyChannel> channel_;
  std::thread thread_;
};

}  // namespace notify
