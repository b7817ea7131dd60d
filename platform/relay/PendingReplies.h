// PendingReplies: the requests of one socket that wait for their reply.
//
// Each entry is taken out exactly once: by the reply that names its id, or
// all together when the socket closes. That is what guarantees a reply
// handler runs once. Internal to platform/relay; not synchronized (the
// channel guards it with its mutex).

#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <unordered_map>
#include <vector>

#include "platform/dispatch/SerialQueue.h"
#include "platform/relay/Event.h"

namespace relay::detail {

struct PendingReply {
  std::shared_ptr<tn::dispatch::SerialQueue> queue;  // where the handler runs
  DescriptorReplyHandler handler;
};

class PendingReplies {
 public:
  void add(uint64_t id, PendingReply pending) { entries_.insert_or_assign(id, std::move(pending)); }

  // The entry for id, removed; none when no request with that id waits.
  std::optional<PendingReply> take(uint64_t id);

  // Every entry, removed, in no particular order.
  std::vector<PendingReply> takeAll();

  std::size_t size() const { return entries_.size(); }

 private:
  std::unordered_map<uint64_t, PendingReply> entries_;
};

}  // namespace relay::detail
