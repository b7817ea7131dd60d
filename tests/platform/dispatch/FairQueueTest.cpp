#include "platform/dispatch/FairQueue.h"

#include <gtest/gtest.h>

#include <mutex>
#include <string>
#include <vector>

#include "platform/dispatch/ThreadPool.h"
#include "tests/platform/dispatch/TestSupport.h"

namespace tn::dispatch {
namespace {

using test::Counter;
using test::Gate;

// The order in which blocks ran, by name.
class Journal {
 public:
  void add(std::string name) {
    const std::lock_guard lock(mutex_);
    names_.push_back(std::move(name));
  }
  std::vector<std::string> names() const {
    const std::lock_guard lock(mutex_);
    return names_;
  }

 private:
  mutable std::mutex mutex_;
  std::vector<std::string> names_;
};

TEST(FairQueue, TakesClientsWithWorkInTurnAndKeepsEachClientsOrder) {
  auto fair = FairQueue::create(SerialQueue::create("fair"));
  const int a = 0, b = 0, c = 0, x = 0;
  Gate started, release;
  Counter done;
  Journal journal;
  // One block holds the queue while the others line up behind it.
  fair->async(&x, [&] {
    started.open();
    const ThreadPool::BlockingScope blocking;
    release.wait();
  });
  started.wait();
  const auto add = [&](const int* client, std::string name) {
    fair->async(client, [&, name] {
      fair->queue()->assertOnQueue();
      journal.add(name);
      done.increment();
    });
  };
  for (int i = 1; i <= 5; ++i) add(&a, "a" + std::to_string(i));
  add(&b, "b1");
  add(&b, "b2");
  add(&c, "c1");
  EXPECT_EQ(fair->pendingCount(&a), 5u);
  EXPECT_EQ(fair->pendingCount(&c), 1u);
  release.open();
  done.waitFor(8);
  const std::vector<std::string> expected{"a1", "b1", "c1", "a2", "b2", "a3", "a4", "a5"};
  EXPECT_EQ(journal.names(), expected);
  EXPECT_EQ(fair->pendingCount(&a), 0u);
}

TEST(FairQueue, AClientThatKeepsQueueingStillLetsAnotherInAfterEachOfItsBlocks) {
  auto fair = FairQueue::create(SerialQueue::create("fair.flood"));
  const int flooder = 0, other = 0, x = 0;
  Journal journal;
  Counter done;
  Gate started, release;
  fair->async(&x, [&] {
    started.open();
    const ThreadPool::BlockingScope blocking;
    release.wait();
  });
  started.wait();
  // The flooder queues its next block from inside each block: it always has
  // work, and the other client still gets every second turn.
  std::function<void(int)> flood = [&](int left) {
    journal.add("f");
    done.increment();
    if (left > 0) fair->async(&flooder, [&, left] { flood(left - 1); });
  };
  fair->async(&flooder, [&] { flood(20); });
  for (int i = 0; i < 3; ++i) {
    fair->async(&other, [&] {
      journal.add("o");
      done.increment();
    });
  }
  release.open();
  done.waitFor(24);
  const std::vector<std::string> names = journal.names();
  std::size_t lastOther = 0;
  for (std::size_t i = 0; i < names.size(); ++i) {
    if (names[i] == "o") lastOther = i;
  }
  // f o f o f o: the flood's first block came first, then turns alternate.
  EXPECT_EQ(lastOther, 5u) << "the other client waited behind the flood";
}

}  // namespace
}  // namespace tn::dispatch
