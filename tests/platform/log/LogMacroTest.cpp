#include <gtest/gtest.h>

#include <atomic>
#include <fmt/format.h>
#include <string>
#include <string_view>

#include "platform/log/Log.h"
#include "tests/platform/log/LogTestSupport.h"

namespace {

// Counts how often a value of this type is formatted.
std::atomic<int> formatCalls{0};
struct CountedArgument {};

}  // namespace

template <>
struct fmt::formatter<CountedArgument> : fmt::formatter<std::string_view> {
  auto format(const CountedArgument&, fmt::format_context& context) const {
    ++formatCalls;
    return fmt::formatter<std::string_view>::format("counted", context);
  }
};

namespace tn::log {
namespace {

using test::LogTest;

// An argument whose evaluation leaves a trace.
CountedArgument evaluate(int& evaluations) {
  ++evaluations;
  return {};
}

class LogMacroTest : public LogTest {
 protected:
  void SetUp() override {
    LogTest::SetUp();
    formatCalls = 0;
  }
};

TEST_F(LogMacroTest, DisabledLevelsEvaluateAndFormatNothing) {
  int evaluations = 0;
  TN_LOG_DEBUG(ops(), "debug {}", evaluate(evaluations));
  TN_LOG_INFO(ops(), "info {} {}", evaluate(evaluations), CountedArgument{});
  TN_LOG_INFO(defaultLog(), "info {}", evaluate(evaluations));

  EXPECT_EQ(evaluations, 0);
  EXPECT_EQ(formatCalls, 0);
  EXPECT_TRUE(capture_->records().empty());
}

TEST_F(LogMacroTest, EnabledLevelsFormatEachArgumentOnce) {
  configure("ops=debug");
  int evaluations = 0;
  TN_LOG_DEBUG(ops(), "client {} sent {} requests: {}", 42, 3, evaluate(evaluations));

  EXPECT_EQ(evaluations, 1);
  EXPECT_EQ(formatCalls, 1);
  EXPECT_EQ(capture_->lines(),
            std::vector<std::string>{"ops debug client 42 sent 3 requests: counted"});
}

TEST_F(LogMacroTest, LogExpressionIsEvaluatedOnceWhetherEnabledOrNot) {
  int lookups = 0;
  auto lookUp = [&]() -> Log& {
    ++lookups;
    return traffic();
  };
  TN_LOG_DEBUG(lookUp(), "off");
  TN_LOG_ERROR(lookUp(), "on");
  EXPECT_EQ(lookups, 2);
  EXPECT_EQ(capture_->lines(), std::vector<std::string>{"traffic error on"});
}

TEST_F(LogMacroTest, DefaultAndErrorAreAlwaysOn) {
  for (Log* log : {&ops(), &traffic(), &extension(), &rg(), &sandbox(), &defaultLog()}) {
    EXPECT_TRUE(log->enabled(Level::Default)) << log->category();
    EXPECT_TRUE(log->enabled(Level::Error)) << log->category();
    EXPECT_FALSE(log->enabled(Level::Info)) << log->category();
    EXPECT_FALSE(log->enabled(Level::Debug)) << log->category();
  }
  TN_LOG_DEFAULT(sandbox(), "no arguments");
  TN_LOG_ERROR(rg(), "failed with {}", "reason");
  EXPECT_EQ(capture_->lines(), (std::vector<std::string>{"sandbox default no arguments",
                                                         "rg error failed with reason"}));
}

TEST_F(LogMacroTest, RecordsCarrySubsystemCategoryLevelAndThread) {
  configure("info");
  TN_LOG_INFO(extension(), "plug-in {} ready", "A");
  TN_LOG_DEFAULT(defaultLog(), "tenond started");

  auto records = capture_->records();
  ASSERT_EQ(records.size(), 2u);
  EXPECT_EQ(records[0].subsystem, "com.ostrel.Tenon");
  EXPECT_EQ(records[0].category, "extension");
  EXPECT_EQ(records[0].level, Level::Info);
  EXPECT_EQ(records[0].text, "plug-in A ready");
  EXPECT_EQ(records[0].thread, ::gettid());
  EXPECT_EQ(records[1].subsystem, "");
  EXPECT_EQ(records[1].category, "default");
  EXPECT_TRUE(capture_->contains("default", Level::Default, "started"));
  EXPECT_FALSE(capture_->contains("default", Level::Error, "started"));
}

TEST_F(LogMacroTest, CaptureHelpersMatchCategoryLevelAndSubstring) {
  configure("debug");
  TN_LOG_DEBUG(ops(), "request {}", 1);
  TN_LOG_DEBUG(ops(), "request {}", 2);
  TN_LOG_INFO(ops(), "request {}", 3);
  EXPECT_EQ(capture_->count("ops", Level::Debug, "request"), 2u);
  EXPECT_EQ(capture_->count("ops", Level::Debug, ""), 2u);
  EXPECT_EQ(capture_->count("traffic", Level::Debug, "request"), 0u);
  EXPECT_TRUE(capture_->contains("ops", Level::Info, "request 3"));
  capture_->clear();
  EXPECT_TRUE(capture_->lines().empty());
}

}  // namespace
}  // namespace tn::log
