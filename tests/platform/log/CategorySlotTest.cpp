#include <gtest/gtest.h>

#include <atomic>
#include <latch>
#include <memory>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "platform/log/Log.h"
#include "tests/platform/log/LogTestSupport.h"

namespace tn::log {
namespace {

using test::LogTest;

constexpr int kThreads = 16;

// Calls slot.get() from kThreads threads released together; returns the
// distinct objects they got.
std::set<Log*> getConcurrently(CategorySlot& slot) {
  std::latch start(kThreads);
  std::vector<Log*> results(kThreads, nullptr);
  std::vector<std::thread> threads;
  for (int i = 0; i < kThreads; ++i) {
    threads.emplace_back([&, i] {
      start.arrive_and_wait();
      results[static_cast<std::size_t>(i)] = &slot.get();
    });
  }
  for (std::thread& thread : threads) thread.join();
  return {results.begin(), results.end()};
}

using CategorySlotTest = LogTest;

TEST_F(CategorySlotTest, ConcurrentFirstUseMakesTheObjectOnce) {
  std::atomic<int> makes{0};
  std::string askedFor;
  CategorySlot slot("traffic", [&](const char* category) {
    ++makes;
    askedFor = category;
    std::this_thread::yield();  // widen the window for a second maker call
    return createLog(kSubsystem, category);
  });

  std::set<Log*> distinct = getConcurrently(slot);
  ASSERT_EQ(distinct.size(), 1u);
  EXPECT_EQ(makes, 1);
  EXPECT_EQ(askedFor, "traffic");
  Log* made = *distinct.begin();
  EXPECT_EQ(made, &slot.get());
  EXPECT_EQ(made->subsystem(), "com.ostrel.Tenon");
  EXPECT_EQ(made->category(), "traffic");
  EXPECT_NE(made, &traffic()) << "a slot of its own makes an object of its own";
  EXPECT_TRUE(capture_->records().empty());
}

TEST_F(CategorySlotTest, FailingMakerFallsBackToTheDefaultLogAndSaysSoOnce) {
  std::atomic<int> makes{0};
  CategorySlot slot("broken", [&](const char*) {
    ++makes;
    return std::shared_ptr<Log>();
  });

  std::set<Log*> distinct = getConcurrently(slot);
  EXPECT_EQ(distinct, std::set<Log*>{&defaultLog()});
  EXPECT_EQ(&slot.get(), &defaultLog());
  EXPECT_EQ(makes, 1);
  EXPECT_EQ(capture_->lines(), std::vector<std::string>{
                                   "default error unable to create tracelog for category broken"});

  TN_LOG_DEFAULT(slot.get(), "goes to the default log");
  EXPECT_TRUE(capture_->contains("default", Level::Default, "goes to the default log"));
}

TEST_F(CategorySlotTest, PlatformMakerRefusesMissingCategoryNames) {
  EXPECT_FALSE(createLog(kSubsystem, nullptr));
  EXPECT_FALSE(createLog(kSubsystem, ""));
  EXPECT_FALSE(createLog(kSubsystem, std::string(256, 'c').c_str()));
  auto made = makeCategoryLog("rg");
  ASSERT_TRUE(made);
  EXPECT_EQ(made->subsystem(), "com.ostrel.Tenon");
  EXPECT_EQ(made->category(), "rg");
}

TEST_F(CategorySlotTest, EachAccessorKeepsOneObjectOfItsCategory) {
  struct Accessor {
    Log& (*get)();
    const char* category;
  };
  const Accessor accessors[] = {{ops, "ops"},
                                {traffic, "traffic"},
                                {extension, "extension"},
                                {rg, "rg"},
                                {sandbox, "sandbox"}};
  std::set<Log*> objects;
  for (const Accessor& accessor : accessors) {
    Log& log = accessor.get();
    EXPECT_EQ(&log, &accessor.get());
    EXPECT_EQ(log.subsystem(), "com.ostrel.Tenon");
    EXPECT_EQ(log.category(), accessor.category);
    objects.insert(&log);
  }
  EXPECT_EQ(objects.size(), 5u);
  EXPECT_EQ(objects.count(&defaultLog()), 0u);
  EXPECT_EQ(defaultLog().subsystem(), "");
  EXPECT_EQ(defaultLog().category(), "default");
}

}  // namespace
}  // namespace tn::log
