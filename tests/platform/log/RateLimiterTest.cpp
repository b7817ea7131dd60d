// The log's rate limiter: a burst then a steady rate per (context, site),
// exact suppression counts in the summaries, summaries when a context ends,
// lines outside a context never limited, and bounded memory.

#include "platform/log/RateLimiter.h"

#include <gtest/gtest.h>

#include <chrono>
#include <string>

#include "platform/log/LogContext.h"
#include "tests/platform/log/LogTestSupport.h"

namespace tn::log {
namespace {

using Clock = RateLimiter::Clock;
using std::chrono::milliseconds;

constexpr int kBurst = static_cast<int>(RateLimiter::kBurst);

class RateLimiterTest : public ::testing::Test {
 protected:
  // Offers `count` lines of site in context at time `at`; how many were written.
  int offer(int count, uint64_t context, const void* site, Clock::time_point at) {
    int written = 0;
    for (int i = 0; i < count; ++i) {
      RateLimiter::Decision decision = limiter_.admit(context, site, ops(), Level::Info, at);
      for (const auto& summary : decision.summaries) summaries_.push_back(summary);
      if (decision.write) ++written;
    }
    return written;
  }

  RateLimiter limiter_;
  std::vector<RateLimiter::Summary> summaries_;
  const Clock::time_point start_ = Clock::time_point(std::chrono::hours(1));
  const char siteA_ = 'a';
  const char siteB_ = 'b';
};

TEST_F(RateLimiterTest, ABurstThenTheRateAndTheSuppressedAreCountedExactly) {
  EXPECT_EQ(offer(1000, 7, &siteA_, start_), kBurst);
  EXPECT_TRUE(summaries_.empty()) << "the summary waits for the next written line";
  // Another site and another context have their own buckets.
  EXPECT_EQ(offer(1, 7, &siteB_, start_), 1);
  EXPECT_EQ(offer(1, 8, &siteA_, start_), 1);

  // One second later: ten more lines, the first preceded by the summary.
  EXPECT_EQ(offer(100, 7, &siteA_, start_ + std::chrono::seconds(1)), 10);
  ASSERT_EQ(summaries_.size(), 1u);
  EXPECT_EQ(summaries_[0].suppressed, 1000u - kBurst);
  EXPECT_EQ(summaries_[0].category, "ops");
  EXPECT_EQ(summaries_[0].level, Level::Info);
  EXPECT_EQ(RateLimiter::summaryText(980), "\u2026 980 similar lines suppressed");

  // 100 ms later one line is allowed, after a summary of the 90 before.
  EXPECT_EQ(offer(1, 7, &siteA_, start_ + std::chrono::seconds(1) + milliseconds(100)), 1);
  ASSERT_EQ(summaries_.size(), 2u);
  EXPECT_EQ(summaries_[1].suppressed, 90u);
}

TEST_F(RateLimiterTest, LinesWithoutContextOrSiteAreNeverLimited) {
  EXPECT_EQ(offer(1000, 0, &siteA_, start_), 1000);
  EXPECT_EQ(offer(1000, 7, nullptr, start_), 1000);
  EXPECT_EQ(limiter_.contextCount(), 0u);
}

TEST_F(RateLimiterTest, EndingAContextHandsBackWhatItOwesAndForgetsIt) {
  offer(kBurst + 5, 7, &siteA_, start_);
  offer(kBurst + 3, 7, &siteB_, start_);
  offer(kBurst, 7, &siteB_ + 1, start_);  // owes nothing
  std::vector<RateLimiter::Summary> owed = limiter_.endContext(7);
  ASSERT_EQ(owed.size(), 2u);
  EXPECT_EQ(owed[0].suppressed + owed[1].suppressed, 8u);
  EXPECT_EQ(limiter_.contextCount(), 0u);
  EXPECT_TRUE(limiter_.endContext(7).empty());
  EXPECT_EQ(offer(kBurst + 1, 7, &siteA_, start_), kBurst) << "a new context starts with a full burst";
}

TEST_F(RateLimiterTest, MemoryIsBounded) {
  // More sites than a context keeps: the rest share one overflow bucket.
  static char sites[RateLimiter::kMaxSitesPerContext * 2];
  int written = 0;
  for (char& site : sites) written += offer(1, 7, &site, start_);
  EXPECT_EQ(limiter_.entryCount(7), RateLimiter::kMaxSitesPerContext);
  EXPECT_EQ(written, static_cast<int>(RateLimiter::kMaxSitesPerContext - 1) + kBurst);

  // More contexts than kept: the least recently used goes, its summary first.
  offer(kBurst + 4, 1, &siteA_, start_);
  summaries_.clear();
  for (uint64_t context = 2; context < 2 + RateLimiter::kMaxContexts; ++context) offer(1, context, &siteA_, start_);
  EXPECT_LE(limiter_.contextCount(), RateLimiter::kMaxContexts);
  ASSERT_FALSE(summaries_.empty());
  uint64_t owedByFirst = 0;
  for (const auto& summary : summaries_) owedByFirst += summary.suppressed;
  EXPECT_EQ(owedByFirst, 4u);
}

// Through the log itself: a context's flood becomes a bounded number of
// lines and a summary; the same lines outside a context all get through.
class LimitedLog : public test::LogTest {};

TEST_F(LimitedLog, AClientsFloodIsSummarisedAndNothingIsLostSilently) {
  constexpr int kLines = 5000;
  const Clock::time_point began = Clock::now();
  std::size_t formatted = 0;  // a suppressed line evaluates and formats nothing
  auto counted = [&](int i) {
    ++formatted;
    return i;
  };
  {
    ContextScope scope(4242);
    EXPECT_EQ(currentContext(), 4242u);
    for (int i = 0; i < kLines; ++i) TN_LOG_DEFAULT(ops(), "refused request {}", counted(i));
  }
  EXPECT_EQ(currentContext(), 0u);
  endContext(4242);
  const double elapsed = std::chrono::duration<double>(Clock::now() - began).count();
  const std::size_t written = capture_->count("ops", Level::Default, "refused request");
  EXPECT_GE(written, static_cast<std::size_t>(kBurst));
  EXPECT_LE(written, static_cast<std::size_t>(kBurst + 1 + elapsed * RateLimiter::kRatePerSecond));
  EXPECT_EQ(formatted, written);
  // Every line is either written or counted in a summary.
  uint64_t suppressed = 0;
  for (const CapturedRecord& record : capture_->records()) {
    unsigned long long n = 0;
    if (std::sscanf(record.text.c_str(), "\u2026 %llu similar lines suppressed", &n) == 1) suppressed += n;
  }
  EXPECT_EQ(written + suppressed, static_cast<uint64_t>(kLines));
  EXPECT_EQ(capture_->lines().back().rfind("ops default \u2026 ", 0), 0u) << capture_->lines().back();

  capture_->clear();
  for (int i = 0; i < kLines; ++i) TN_LOG_DEFAULT(ops(), "refused request {}", i);
  EXPECT_EQ(capture_->count("ops", Level::Default, "refused request"), static_cast<std::size_t>(kLines));
}

TEST_F(LimitedLog, ScopesNest) {
  ContextScope outer(1);
  {
    ContextScope inner(2);
    EXPECT_EQ(currentContext(), 2u);
  }
  EXPECT_EQ(currentContext(), 1u);
}

}  // namespace
}  // namespace tn::log
