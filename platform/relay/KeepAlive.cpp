#include "platform/relay/KeepAlive.h"

#include <atomic>
#include <cstdio>
#include <cstdlib>

namespace relay {
namespace {

std::atomic<uint64_t> count{0};
std::atomic<void (*)()> activityHandler{nullptr};

}  // namespace

void transactionBegin() { count.fetch_add(1, std::memory_order_relaxed); }

void transactionEnd() {
  uint64_t current = count.load(std::memory_order_relaxed);
  do {
    if (current == 0) {
      std::fputs("tenon: fatal: relay::transactionEnd() without a transactionBegin()\n", stderr);
      std::abort();
    }
  } while (!count.compare_exchange_weak(current, current - 1, std::memory_order_relaxed));
  activityEnded();
}

uint64_t keepAliveCount() { return count.load(std::memory_order_relaxed); }

void setActivityEndedHandler(void (*handler)()) { activityHandler.store(handler); }

void activityEnded() {
  if (void (*const handler)() = activityHandler.load()) handler();
}

}  // namespace relay
