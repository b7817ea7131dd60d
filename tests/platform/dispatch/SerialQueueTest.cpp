#include "platform/dispatch/SerialQueue.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <cstddef>
#include <memory>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "platform/dispatch/ThreadPool.h"
#include "tests/platform/dispatch/TestSupport.h"

namespace tn::dispatch {
namespace {

using test::Counter;
using test::Gate;
using test::eventually;

// Fails the test if two blocks of one queue ever overlap.
class OverlapDetector {
 public:
  class Scope {
   public:
    explicit Scope(OverlapDetector& detector) : detector_(detector) {
      if (detector_.inside_.fetch_add(1) != 0) {
        detector_.overlaps_.fetch_add(1);
      }
    }
    ~Scope() { detector_.inside_.fetch_sub(1); }
    Scope(const Scope&) = delete;
    Scope& operator=(const Scope&) = delete;

   private:
    OverlapDetector& detector_;
  };
  int overlaps() const { return overlaps_.load(); }

 private:
  std::atomic<int> inside_{0};
  std::atomic<int> overlaps_{0};
};

TEST(SerialQueue, KeepsLabelAndQualityOfService) {
  const auto plain = SerialQueue::create("plain");
  const auto service = SerialQueue::create("service", 25);
  EXPECT_EQ(plain->label(), "plain");
  EXPECT_EQ(plain->qualityOfService(), 0);
  EXPECT_EQ(service->label(), "service");
  EXPECT_EQ(service->qualityOfService(), 25);
}

TEST(SerialQueue, RunsBlocksOneAtATimeInFifoOrderUnderManyProducers) {
  const auto queue = SerialQueue::create("fifo");
  constexpr int kProducers = 8;
  constexpr int kPerProducer = 500;
  std::vector<std::pair<int, int>> log;  // owned by `queue`
  OverlapDetector overlap;
  Counter done;
  std::vector<std::thread> producers;
  for (int p = 0; p < kProducers; ++p) {
    producers.emplace_back([&, p] {
      for (int i = 0; i < kPerProducer; ++i) {
        queue->async([&, p, i] {
          const OverlapDetector::Scope scope(overlap);
          log.emplace_back(p, i);
          done.increment();
        });
      }
    });
  }
  for (auto& producer : producers) {
    producer.join();
  }
  done.waitFor(kProducers * kPerProducer);
  const auto copy = queue->sync([&] { return log; });
  ASSERT_EQ(copy.size(), static_cast<std::size_t>(kProducers * kPerProducer));
  std::vector<int> next(kProducers, 0);
  for (const auto& [producer, index] : copy) {
    ASSERT_EQ(index, next[static_cast<std::size_t>(producer)]) << "producer " << producer;
    ++next[static_cast<std::size_t>(producer)];
  }
  EXPECT_EQ(overlap.overlaps(), 0);
}

TEST(SerialQueue, SyncWaitsForEarlierAsyncsAndKeepsLaterOnesOut) {
  const auto queue = SerialQueue::create("interleave");
  // The test thread interleaves asyncs and syncs; a noise thread keeps the
  // queue busy at the same time so that both the inline and the hand-off
  // paths of sync are taken.
  std::vector<int> mine;  // owned by `queue`
  std::atomic<bool> stopNoise{false};
  OverlapDetector overlap;
  std::thread noise([&] {
    while (!stopNoise.load()) {
      if (queue->pendingCount() < 4) {  // a little backlog, not a flood
        queue->async([&] { const OverlapDetector::Scope scope(overlap); });
      } else {
        std::this_thread::yield();
      }
    }
  });
  int failures = 0;
  for (int round = 0; round < 300; ++round) {
    queue->async([&, round] {
      const OverlapDetector::Scope scope(overlap);
      mine.push_back(2 * round);
    });
    queue->async([&, round] {
      const OverlapDetector::Scope scope(overlap);
      mine.push_back(2 * round + 1);
    });
    const bool ok = queue->sync([&] {
      const OverlapDetector::Scope scope(overlap);
      // Both earlier asyncs done, and nothing of later rounds started.
      return mine.size() == static_cast<std::size_t>(2 * round + 2) && mine.back() == 2 * round + 1;
    });
    if (!ok) {
      ++failures;
    }
  }
  stopNoise.store(true);
  noise.join();
  queue->sync([] {});
  EXPECT_EQ(failures, 0);
  EXPECT_EQ(overlap.overlaps(), 0);
}

TEST(SerialQueue, SyncRunsOnTheCallingThreadAndReturnsTheBlocksResult) {
  const auto queue = SerialQueue::create("results");
  const auto caller = std::this_thread::get_id();
  EXPECT_EQ(queue->sync([] { return 42; }), 42);
  EXPECT_EQ(queue->sync([] { return std::string("text"); }), "text");
  auto owned = queue->sync([] { return std::make_unique<int>(7); });
  ASSERT_NE(owned, nullptr);
  EXPECT_EQ(*owned, 7);
  int value = 1;
  int& ref = queue->sync([&]() -> int& { return value; });
  EXPECT_EQ(&ref, &value);
  std::thread::id ranOn;
  queue->sync([&] { ranOn = std::this_thread::get_id(); });
  EXPECT_EQ(ranOn, caller);
}

TEST(SerialQueue, InlineSyncOnAnIdleQueueNeedsNoPoolThread) {
  // The private pool's only worker is stuck, so a sync that went through the
  // pool would hang; on an idle queue it must not need it.
  ThreadPool pool(1, 1);
  const auto queue = SerialQueue::create("idle", 0, pool);
  Gate release;
  pool.submit([&] { release.wait(); });
  EXPECT_EQ(queue->sync([] { return 5; }), 5);
  release.open();
}

TEST(SerialQueue, HandsTheQueueToTheSyncCallerWithoutHoldingAPoolThread) {
  // One pool worker. While the sync caller runs its block, that worker must
  // be free: the block itself needs it.
  ThreadPool pool(1, 1);
  const auto queue = SerialQueue::create("handoff", 0, pool);
  Gate firstStarted;
  Gate releaseFirst;
  std::vector<int> order;  // owned by `queue`
  queue->async([&] {
    firstStarted.open();
    releaseFirst.wait();
    order.push_back(1);
  });
  firstStarted.wait();
  std::atomic<bool> poolRanDuringSync{false};
  std::thread caller([&] {
    queue->sync([&] {
      order.push_back(2);
      Gate ran;
      pool.submit([&] { ran.open(); });
      ran.wait();
      poolRanDuringSync.store(true);
    });
  });
  // Let the first block finish only once the caller waits behind it, so the
  // queue has to be handed over rather than taken inline.
  ASSERT_TRUE(eventually([&] { return queue->pendingCount() == 1; }));
  queue->async([&] { order.push_back(3); });
  releaseFirst.open();
  caller.join();
  EXPECT_TRUE(poolRanDuringSync.load());
  EXPECT_EQ(queue->sync([&] { return order; }), (std::vector<int>{1, 2, 3}));
}

TEST(SerialQueue, SyncFromAPoolThreadOntoAnotherQueue) {
  const auto outer = SerialQueue::create("outer");
  const auto inner = SerialQueue::create("inner");
  Gate done;
  int answer = 0;
  bool held = false;
  bool onPool = false;
  outer->async([&] {
    answer = inner->sync([&] {
      held = outer->isCurrent() && inner->isCurrent() && SerialQueue::current() == inner.get();
      onPool = ThreadPool::current() == &ThreadPool::shared();
      return 17;
    });
    done.open();
  });
  done.wait();
  outer->sync([] {});
  EXPECT_EQ(answer, 17);
  EXPECT_TRUE(held);
  EXPECT_TRUE(onPool);
}

TEST(SerialQueue, NestedSyncHoldsBothQueuesAndTracksTheInnermost) {
  const auto a = SerialQueue::create("A");
  const auto b = SerialQueue::create("B");
  EXPECT_EQ(SerialQueue::current(), nullptr);
  a->sync([&] {
    EXPECT_EQ(SerialQueue::current(), a.get());
    b->sync([&] {
      EXPECT_EQ(SerialQueue::current(), b.get());
      EXPECT_TRUE(a->isCurrent());
      EXPECT_TRUE(b->isCurrent());
      a->assertOnQueue();
      b->assertOnQueue();
    });
    EXPECT_EQ(SerialQueue::current(), a.get());
    EXPECT_FALSE(b->isCurrent());
  });
  EXPECT_EQ(SerialQueue::current(), nullptr);
  EXPECT_FALSE(a->isCurrent());
}

TEST(SerialQueue, AsyncBlocksSeeTheirQueueAsCurrent) {
  const auto queue = SerialQueue::create("current");
  const auto other = SerialQueue::create("other");
  Gate done;
  bool current = false;
  bool otherCurrent = true;
  queue->async([&] {
    queue->assertOnQueue();
    current = queue->isCurrent() && SerialQueue::current() == queue.get();
    otherCurrent = other->isCurrent();
    done.open();
  });
  done.wait();
  queue->sync([] {});
  EXPECT_TRUE(current);
  EXPECT_FALSE(otherCurrent);
  EXPECT_FALSE(queue->isCurrent());
}

TEST(SerialQueue, AsyncFromABlockRunsAfterIt) {
  const auto queue = SerialQueue::create("reentrant");
  std::vector<int> order;  // owned by `queue`
  Gate done;
  queue->async([&] {
    queue->async([&] {
      order.push_back(2);
      done.open();
    });
    order.push_back(1);
  });
  done.wait();
  EXPECT_EQ(queue->sync([&] { return order; }), (std::vector<int>{1, 2}));
}

TEST(SerialQueue, StaysAliveWhileItHasWorkAfterTheLastReferenceIsDropped) {
  auto queue = SerialQueue::create("orphan");
  const std::weak_ptr<SerialQueue> weak = queue;
  Gate release;
  Counter ran;
  queue->async([&] { release.wait(); });
  for (int i = 0; i < 40; ++i) {  // more than one batch
    queue->async([&] { ran.increment(); });
  }
  queue.reset();
  EXPECT_FALSE(weak.expired());
  release.open();
  ran.waitFor(40);
  EXPECT_TRUE(eventually([&] { return weak.expired(); }));
}

TEST(SerialQueue, ABusyQueueDoesNotStarveOthers) {
  // One worker. The busy queue's backlog is far longer than a batch; the
  // other queue's block, queued behind the busy queue's first turn, must run
  // long before the backlog is gone.
  ThreadPool pool(1, 1);
  const auto busy = SerialQueue::create("busy", 0, pool);
  const auto other = SerialQueue::create("other", 0, pool);
  Gate release;
  pool.submit([&] { release.wait(); });
  constexpr int kBacklog = 10 * static_cast<int>(SerialQueue::kBatchLimit);
  // Written by `busy`'s blocks, read by `other`'s: a sync onto `busy` would
  // need a second worker, so this is read directly.
  std::atomic<int> busyRan{0};
  std::atomic<int> busyRanWhenOtherRan{-1};
  Counter done;
  for (int i = 0; i < kBacklog; ++i) {
    busy->async([&] {
      busyRan.fetch_add(1);
      done.increment();
    });
  }
  other->async([&] {
    busyRanWhenOtherRan.store(busyRan.load());
    done.increment();
  });
  release.open();
  done.waitFor(kBacklog + 1);
  EXPECT_GE(busyRanWhenOtherRan.load(), 1);
  EXPECT_LE(busyRanWhenOtherRan.load(), static_cast<int>(SerialQueue::kBatchLimit));
}

TEST(SerialQueue, MixedTrafficKeepsEveryQueueSerialAndEachSendersOrder) {
  // Threads and pool blocks mix async, sync and nested sync (always from a
  // lower to a higher queue index: a lock order) over a few queues. Every
  // queue must run one block at a time, and the blocks one sender put on one
  // queue must run in the order sent.
  constexpr std::size_t kQueues = 4;
  constexpr int kSenders = 4;
  constexpr int kOps = 400;
  std::vector<std::shared_ptr<SerialQueue>> queues;
  std::vector<OverlapDetector> overlap(kQueues);
  // last[q][s]: the last sequence number of sender s seen on queue q; owned
  // by queue q.
  std::vector<std::vector<int>> last(kQueues, std::vector<int>(kSenders, -1));
  std::atomic<int> outOfOrder{0};
  for (std::size_t q = 0; q < kQueues; ++q) {
    queues.push_back(SerialQueue::create("mixed" + std::to_string(q)));
  }
  const auto record = [&](std::size_t q, int sender, int seq) {
    const OverlapDetector::Scope scope(overlap[q]);
    if (last[q][static_cast<std::size_t>(sender)] >= seq) {
      outOfOrder.fetch_add(1);
    }
    last[q][static_cast<std::size_t>(sender)] = seq;
  };
  Counter asyncsDone;
  std::atomic<int> asyncsSent{0};
  std::vector<std::thread> senders;
  for (int sender = 0; sender < kSenders; ++sender) {
    senders.emplace_back([&, sender] {
      unsigned state = 2463534242u + static_cast<unsigned>(sender);
      const auto next = [&state] {
        state ^= state << 13;
        state ^= state >> 17;
        state ^= state << 5;
        return state;
      };
      for (int seq = 0; seq < kOps; ++seq) {
        const std::size_t q = next() % kQueues;
        switch (next() % 3) {
          case 0:
            asyncsSent.fetch_add(1);
            queues[q]->async([&, q, sender, seq] {
              record(q, sender, seq);
              if (q + 1 < kQueues) {  // a pool thread syncing onward
                queues[q + 1]->sync([&] { const OverlapDetector::Scope s(overlap[q + 1]); });
              }
              asyncsDone.increment();
            });
            break;
          case 1:
            queues[q]->sync([&] { record(q, sender, seq); });
            break;
          default:
            queues[q]->sync([&] {
              record(q, sender, seq);
              for (std::size_t inner = q + 1; inner < kQueues; ++inner) {
                queues[inner]->sync([&] { const OverlapDetector::Scope s(overlap[inner]); });
              }
            });
            break;
        }
      }
    });
  }
  for (auto& sender : senders) {
    sender.join();
  }
  asyncsDone.waitFor(static_cast<std::size_t>(asyncsSent.load()));
  EXPECT_EQ(outOfOrder.load(), 0);
  for (std::size_t q = 0; q < kQueues; ++q) {
    EXPECT_EQ(overlap[q].overlaps(), 0) << "queue " << q;
  }
}

TEST(SerialQueue, TenThousandQueuesAliveAtOnceEachDoingWork) {
  constexpr std::size_t kQueues = 10'000;
  constexpr int kBlocks = 3;
  std::vector<std::shared_ptr<SerialQueue>> queues;
  queues.reserve(kQueues);
  std::vector<int> counts(kQueues, 0);  // counts[i] owned by queues[i]
  Counter done;
  for (std::size_t i = 0; i < kQueues; ++i) {
    queues.push_back(SerialQueue::create("q" + std::to_string(i)));
  }
  for (int block = 0; block < kBlocks; ++block) {
    for (std::size_t i = 0; i < kQueues; ++i) {
      queues[i]->async([&counts, &done, i, block] {
        if (counts[i] == block) {
          ++counts[i];
        }
        if (block == kBlocks - 1) {
          done.increment();
        }
      });
    }
  }
  done.waitFor(kQueues);
  std::size_t correct = 0;
  for (std::size_t i = 0; i < kQueues; ++i) {
    correct += queues[i]->sync([&] { return counts[i] == kBlocks ? 1u : 0u; });
  }
  EXPECT_EQ(correct, kQueues);
  EXPECT_LE(ThreadPool::shared().counts().threads, ThreadPool::shared().maxThreadCount());
}

TEST(SerialQueue, NoDeadlockWhenMoreQueuesWaitInSyncThanThereAreBaseWorkers) {
  // Each waiter queue's block syncs onto `slow`, whose first block holds it
  // until every waiter has started. With only the base workers, the waiters
  // would occupy all of them and the ones queued after could never start.
  ThreadPool& pool = ThreadPool::shared();
  const std::size_t waiters = pool.baseThreadCount() + 6;
  ASSERT_LT(waiters + 1, pool.maxThreadCount());
  const auto slow = SerialQueue::create("slow");
  Gate gate;
  slow->async([&] {
    const ThreadPool::BlockingScope blocking;  // as Semaphore::wait would
    gate.wait();
  });
  std::vector<std::shared_ptr<SerialQueue>> queues;
  Counter started;
  Counter finished;
  std::atomic<int> sum{0};
  for (std::size_t i = 0; i < waiters; ++i) {
    queues.push_back(SerialQueue::create("waiter" + std::to_string(i)));
    queues.back()->async([&, i] {
      started.increment();
      sum.fetch_add(slow->sync([i] { return static_cast<int>(i); }));
      finished.increment();
    });
  }
  started.waitFor(waiters);
  for (int i = 0; i < 20; ++i) {  // keep feeding the slow queue
    slow->async([] {});
  }
  gate.open();
  finished.waitFor(waiters);
  EXPECT_EQ(sum.load(), static_cast<int>(waiters * (waiters - 1) / 2));
}

}  // namespace
}  // namespace tn::dispatch
