#pragma once

// InstallWatcher: notices changes under the application roots with inotify
// and tells its owner which paths changed, once they are complete.
//
// One inotify descriptor and one thread for any number of directories (an
// installation has thousands: each root, each application, its Support and
// Support/PlugIns directories and each plug-in bundle, so the one thread per
// directory of notify::DirectoryWatch does not fit here). The owner adds
// directories with watch() as it scans them; a directory created inside a
// watched one is watched at once by the thread itself (with what it already
// holds), so that a copy in progress is followed. A watch goes away by
// itself when its directory does.
//
// Changes are gathered by group (the owner's groupOf: for the registrar,
// the application or bundle a path belongs to), and each group is handed
// over on its own, so that one copy in progress delays nothing else.
// When is a group's change complete (docs/registrar.md, "Watching")?
// - Made only of renames and removals (an installer renaming a finished
//   directory into a root, an application deleted): at once.
// - Otherwise (files created or written: a copy in progress) once no
//   regular file seen created in it is still open for writing (each
//   IN_CREATE of a regular file needs its IN_CLOSE_WRITE, or its removal)
//   and nothing happened in it for the settle time. A group never waits
//   longer than kMaxPendingTime: a file held open for ever is read as it
//   is, and its close is a new change.
// The callback runs on the thread; it should only queue work.

#include <chrono>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <thread>
#include <unordered_map>

#include "platform/notify/InotifyChannel.h"
#include "platform/value/Result.h"

namespace registrar {

// What changed: the paths of the entries (or watched directories) that
// events named. overflowed: events were lost; the owner must rescan all.
struct WatchedChanges {
  std::set<std::string> paths;
  bool overflowed = false;
};

class InstallWatcher {
  struct CreateTag {
    explicit CreateTag() = default;
  };

 public:
  using Callback = std::function<void(WatchedChanges changes)>;
  using GroupOf = std::function<std::string(const std::string& path)>;

  // A batch with files still open for writing is delivered after this long
  // all the same.
  static constexpr std::chrono::milliseconds kMaxPendingTime{5000};

  static tn::Result<std::unique_ptr<InstallWatcher>> create(std::chrono::milliseconds settle, GroupOf groupOf,
                                                            Callback callback);

  // Stops the thread; no callback runs after the destructor returns. Must
  // not be called from the callback.
  ~InstallWatcher();
  InstallWatcher(const InstallWatcher&) = delete;
  InstallWatcher& operator=(const InstallWatcher&) = delete;

  // Watches the directory at path (links followed) for entries created,
  // removed, renamed or written. Adding a directory twice is harmless.
  // False (logged at debug level) when it cannot be watched. Any thread.
  bool watch(const std::string& path);

  InstallWatcher(CreateTag, std::chrono::milliseconds settle, GroupOf groupOf, Callback callback,
                 std::unique_ptr<notify::InotifyChannel> channel);

 private:
  struct Group;
  using Groups = std::map<std::string, Group>;
  void run();
  void take(Groups& groups, bool& overflowed, int watch, uint32_t mask, std::string_view name);
  // Hands over the groups that are complete; the milliseconds until the
  // next one may be (-1: none pending).
  int deliverReady(Groups& groups);
  void watchCreatedTree(const std::string& path, int depth);
  std::string pathOfWatch(int watch);

  const std::chrono::milliseconds settle_;
  const GroupOf groupOf_;
  const Callback callback_;
  const std::unique_ptr<notify::InotifyChannel> channel_;

  std::mutex watchesMutex_;
  // The path each watch was last added with; a directory renamed keeps
  // its watch, and the next scan of its new place adds it again.
  std::unordered_map<int, std::string> pathByWatch_;  // guarded by watchesMutex_

  std::thread thread_;
};

}  // namespace registrar
