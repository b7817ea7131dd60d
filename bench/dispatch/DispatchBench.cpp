// Costs of the queue operations the daemon uses on every request.

#include <benchmark/benchmark.h>

#include <cstddef>
#include <memory>
#include <string>
#include <vector>

#include "platform/dispatch/Semaphore.h"
#include "platform/dispatch/SerialQueue.h"

namespace tn::dispatch {
namespace {

// async() of `range(0)` empty blocks onto one queue, then one sync to wait.
void BM_AsyncThroughput(benchmark::State& state) {
  const auto queue = SerialQueue::create("bench.async");
  const auto count = static_cast<std::size_t>(state.range(0));
  for (auto _ : state) {
    for (std::size_t i = 0; i < count; ++i) {
      queue->async([] {});
    }
    queue->sync([] {});
  }
  state.SetItemsProcessed(state.iterations() * state.range(0));
}
BENCHMARK(BM_AsyncThroughput)->Arg(1)->Arg(64)->Arg(4096);

// sync() onto an idle queue: the inline path, no thread switch.
void BM_InlineSync(benchmark::State& state) {
  const auto queue = SerialQueue::create("bench.inline");
  int value = 0;
  for (auto _ : state) {
    benchmark::DoNotOptimize(queue->sync([&] { return ++value; }));
  }
}
BENCHMARK(BM_InlineSync);

// sync() behind one async block: the queue is handed to the caller by a
// pool thread (one round trip).
void BM_SyncBehindAsync(benchmark::State& state) {
  const auto queue = SerialQueue::create("bench.handoff");
  int value = 0;
  for (auto _ : state) {
    queue->async([&] { ++value; });
    benchmark::DoNotOptimize(queue->sync([&] { return value; }));
  }
}
BENCHMARK(BM_SyncBehindAsync);

// One block on each of `range(0)` fresh queues, waited for with a semaphore.
void BM_FanOutOverQueues(benchmark::State& state) {
  const auto count = static_cast<std::size_t>(state.range(0));
  for (auto _ : state) {
    std::vector<std::shared_ptr<SerialQueue>> queues;
    queues.reserve(count);
    Semaphore done;
    for (std::size_t i = 0; i < count; ++i) {
      queues.push_back(SerialQueue::create("bench.fan"));
      queues.back()->async([&done] { done.signal(); });
    }
    for (std::size_t i = 0; i < count; ++i) {
      done.wait();
    }
  }
  state.SetItemsProcessed(state.iterations() * state.range(0));
}
BENCHMARK(BM_FanOutOverQueues)->Arg(100)->Arg(10000);

}  // namespace
}  // namespace tn::dispatch
