// FairQueue: one serial queue shared by many clients, which takes them in
// turn.
//
// Blocks are given on behalf of a client (any key that stays unique while
// the client has blocks queued). They run one at a time on the underlying
// SerialQueue, like that queue's own blocks, but the next block to run is
// chosen among the clients in turn: one block of each client that has work,
// round robin, first come first served within a client. A client that
// queues a thousand blocks therefore delays another client's next block by
// at most one block of its own, and each client's blocks still run in the
// order it gave them.
//
//   auto fair = FairQueue::create(SerialQueue::create("service"));
//   fair->async(client.get(), [=] { ... });
//
// Threads: any. Each async() puts one turn on the underlying queue, so
// everything the SerialQueue promises about its blocks (one at a time,
// assertOnQueue, sync from elsewhere) holds for these blocks as well.

#pragma once

#include <cstddef>
#include <deque>
#include <functional>
#include <list>
#include <memory>
#include <mutex>
#include <unordered_map>

#include "platform/dispatch/SerialQueue.h"

namespace tn::dispatch {

class FairQueue : public std::enable_shared_from_this<FairQueue> {
  struct CreateTag {
    explicit CreateTag() = default;
  };

 public:
  using ClientKey = const void*;

  static std::shared_ptr<FairQueue> create(std::shared_ptr<SerialQueue> queue);
  FairQueue(CreateTag, std::shared_ptr<SerialQueue> queue);

  // Queues `block` behind the earlier blocks of `client`. Any thread.
  void async(ClientKey client, std::function<void()> block);

  // Blocks of `client` queued and not yet started. Any thread.
  std::size_t pendingCount(ClientKey client) const;

  const std::shared_ptr<SerialQueue>& queue() const { return queue_; }

 private:
  struct Backlog {
    ClientKey client;
    std::deque<std::function<void()>> blocks;
  };
  using Ring = std::list<Backlog>;

  // One turn on the underlying queue: the front client's first block.
  void runNextTurn();

  const std::shared_ptr<SerialQueue> queue_;
  mutable std::mutex mutex_;
  Ring ring_;                                           // clients with blocks, in turn order; guarded
  std::unordered_map<ClientKey, Ring::iterator> index_;  // guarded by mutex_
};

}  // namespace tn::dispatch
