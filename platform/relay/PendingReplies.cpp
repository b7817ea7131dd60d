#include "platform/relay/PendingReplies.h"

namespace relay::detail {

std::optional<PendingReply> PendingReplies::take(uint64_t id) {
  const auto it = entries_.find(id);
  if (it == entries_.end()) return std::nullopt;
  PendingReply pending = std::move(it->second);
  entries_.erase(it);
  return pending;
}

std::vector<PendingReply> PendingReplies::takeAll() {
  std::vector<PendingReply> all;
  all.reserve(entries_.size());
  for (auto& [id, pending] : entries_) all.push_back(std::move(pending));
  entries_.clear();
  return all;
}

}  // namespace relay::detail
