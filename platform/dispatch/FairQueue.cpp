#include "platform/dispatch/FairQueue.h"

#include <utility>

namespace tn::dispatch {

std::shared_ptr<FairQueue> FairQueue::create(std::shared_ptr<SerialQueue> queue) {
  return std::make_shared<FairQueue>(CreateTag{}, std::move(queue));
}

FairQueue::FairQueue(CreateTag, std::shared_ptr<SerialQueue> queue) : queue_(std::move(queue)) {}

void FairQueue::async(ClientKey client, std::function<void()> block) {
  {
    const std::lock_guard lock(mutex_);
    auto found = index_.find(client);
    if (found == index_.end()) {
      ring_.push_back(Backlog{client, {}});
      found = index_.emplace(client, std::prev(ring_.end())).first;
    }
    found->second->blocks.push_back(std::move(block));
  }
  queue_->async([self = shared_from_this()] { self->runNextTurn(); });
}

std::size_t FairQueue::pendingCount(ClientKey client) const {
  const std::lock_guard lock(mutex_);
  const auto found = index_.find(client);
  return found == index_.end() ? 0 : found->second->blocks.size();
}

void FairQueue::runNextTurn() {
  std::function<void()> block;
  {
    const std::lock_guard lock(mutex_);
    // Every async() queued exactly one turn, so a turn always finds a block.
    Backlog& front = ring_.front();
    block = std::move(front.blocks.front());
    front.blocks.pop_front();
    if (front.blocks.empty()) {
      index_.erase(front.client);
      ring_.pop_front();
    } else {
      ring_.splice(ring_.end(), ring_, ring_.begin());  // to the back of the line
    }
  }
  block();
}

}  // namespace tn::dispatch
