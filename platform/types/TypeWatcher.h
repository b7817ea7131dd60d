#pragma once

// TypeWatcher: tells the type hierarchy when one of its sources may have
// changed. Internal to platform/types.
//
// It watches every MIME directory and the declarations directory, and the
// directory above each (so a directory that appears later is noticed), on
// one inotify descriptor served by one thread. Events are gathered until
// kSettle passes without more (the MIME database is rewritten as a dozen
// files at once), then the watches are renewed and the callback runs on
// the watcher's thread. Only entries named like a source count: subclasses,
// aliases, *.manifest, and the directories mime, tenon and types.

#include <chrono>
#include <functional>
#include <memory>
#include <thread>

#include "platform/notify/InotifyChannel.h"
#include "platform/types/TypeSources.h"
#include "platform/value/Result.h"

namespace types {

class TypeWatcher {
  struct CreateTag {
    explicit CreateTag() = default;
  };

 public:
  static constexpr std::chrono::milliseconds kSettle{50};

  static tn::Result<std::unique_ptr<TypeWatcher>> create(const TypePaths& paths, std::function<void()> changed);
  // Stops the thread; no callback runs after it returns. Not from the
  // callback.
  ~TypeWatcher();
  TypeWatcher(const TypeWatcher&) = delete;
  TypeWatcher& operator=(const TypeWatcher&) = delete;

  TypeWatcher(CreateTag, TypePaths paths, std::function<void()> changed,
              std::unique_ptr<notify::InotifyChannel> channel);

 private:
  void addWatches();
  void run();
  // Reads pending events; true when one may concern a source.
  bool drainRelevant();

  const TypePaths paths_;
  const std::function<void()> changed_;
  const std::unique_ptr<notify::InotifyChannel> channel_;
  std::thread thread_;
};

}  // namespace types
