#include "platform/notify/Observer.h"

#include <algorithm>
#include <mutex>
#include <optional>

#include <fmt/format.h>

#include "platform/log/Log.h"
#include "platform/notify/NotificationName.h"
#include "platform/notify/Post.h"

namespace notify {

struct Observer::Delivery : std::enable_shared_from_this<Delivery> {
  Delivery(std::string notificationName, std::shared_ptr<tn::dispatch::SerialQueue> handlerQueue,
           std::function<void()> handlerBlock)
      : name(std::move(notificationName)), queue(std::move(handlerQueue)), handler(std::move(handlerBlock)) {}

  // Runs on the watch thread: queues one handler call per post made since
  // the count was last read.
  void deliverNewPosts() {
    const tn::Result<uint64_t> count = postCount(name);
    if (!count) {
      TN_LOG_ERROR(tn::log::ops(), "notification observer for {}: {}", name, count.error().description());
      return;
    }
    uint64_t pending = 0;
    {
      const std::lock_guard lock(mutex);
      if (!seen) return;  // create() has not read the starting count yet
      if (*count < *seen) seen = 0;  // the file was removed and started over
      pending = std::min(*count - *seen, kMaxBurst);
      seen = *count;
    }
    for (uint64_t i = 0; i < pending; ++i) {
      queue->async([self = shared_from_this()] {
        if (!self->cancelled.load()) self->handler();
      });
    }
  }

  const std::string name;
  const std::shared_ptr<tn::dispatch::SerialQueue> queue;
  const std::function<void()> handler;
  std::atomic<bool> cancelled{false};
  std::mutex mutex;
  std::optional<uint64_t> seen;  // guarded by mutex: the count handled so far
};

tn::Result<std::unique_ptr<Observer>> Observer::create(std::string_view name,
                                                       std::shared_ptr<tn::dispatch::SerialQueue> queue,
                                                       std::function<void()> handler) {
  if (tn::Result<void> valid = validateNotificationName(name); !valid) return valid.error();
  if (!queue || !handler) {
    return notifyError(NotifyErrorCode::InvalidArgument, "an observer needs a queue and a handler");
  }
  if (tn::Result<void> created = createNotificationDirectory(); !created) return created.error();

  auto delivery = std::make_shared<Delivery>(std::string(name), queue, std::move(handler));
  auto watch = DirectoryWatch::create(notificationDirectory(), [delivery](const DirectoryChanges& changes) {
    if (changes.touches(delivery->name) || changes.directoryGone) delivery->deliverNewPosts();
    if (changes.directoryGone) {
      TN_LOG_ERROR(tn::log::ops(), "notification observer for {} stopped: {} is gone", delivery->name,
                   notificationDirectory());
    }
  });
  if (!watch) return watch.error();
  // The count is read after the watch is in place, so no post falls between.
  tn::Result<uint64_t> count = postCount(name);
  if (!count) return count.error();
  {
    const std::lock_guard lock(delivery->mutex);
    delivery->seen = *count;
  }
  return std::make_unique<Observer>(CreateTag(), std::string(name), std::move(queue), std::move(delivery),
                                    std::move(*watch));
}

Observer::Observer(CreateTag, std::string name, std::shared_ptr<tn::dispatch::SerialQueue> queue,
                   std::shared_ptr<Delivery> delivery, std::unique_ptr<DirectoryWatch> watch)
    : name_(std::move(name)), queue_(std::move(queue)), delivery_(std::move(delivery)), watch_(std::move(watch)) {}

Observer::~Observer() {
  watch_.reset();  // no more calls get queued
  delivery_->cancelled.store(true);
  // Blocks queued before this point now skip the handler; wait for one that
  // may be running it, unless that is our caller.
  if (!queue_->isCurrent()) queue_->sync([] {});
}

}  // namespace notify
