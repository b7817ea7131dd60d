#include "platform/relay/InboundBudget.h"

namespace relay::detail {

void InboundBudget::charge(std::size_t bytes) {
  messages_.fetch_add(1);
  bytes_.fetch_add(bytes);
}

bool InboundBudget::release(std::size_t bytes) {
  messages_.fetch_sub(1);
  bytes_.fetch_sub(bytes);
  // Whoever flips paused_ back owns the resume; the loads and the exchange
  // are sequentially consistent, so pause() and release() cannot both miss.
  return paused_.load() && belowResumeMark() && paused_.exchange(false);
}

bool InboundBudget::exhausted() const {
  return messages_.load() >= limits_.messages || bytes_.load() >= limits_.bytes;
}

bool InboundBudget::pause() {
  paused_.store(true);
  if (belowResumeMark() && paused_.exchange(false)) return false;
  return true;
}

bool InboundBudget::belowResumeMark() const {
  return messages_.load() <= limits_.messages / 2 && bytes_.load() <= limits_.bytes / 2;
}

}  // namespace relay::detail
