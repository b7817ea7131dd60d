#include <gtest/gtest.h>

#include <cstdlib>
#include <string>
#include <vector>

#include "platform/log/Log.h"
#include "tests/platform/log/LogTestSupport.h"

namespace tn::log {
namespace {

using test::LogTest;

// --- The TENON_LOG syntax ---

TEST(LogSettingsParse, BareLevelSetsEveryCategoryAndNamedCategoriesWin) {
  auto parsed = parseLogSettings("ops=debug, info ,sandbox=default", "TENON_LOG");
  EXPECT_TRUE(parsed.problems.empty());
  EXPECT_EQ(parsed.settings.verbosityFor("ops"), Verbosity::Debug);
  EXPECT_EQ(parsed.settings.verbosityFor("traffic"), Verbosity::Info);
  EXPECT_EQ(parsed.settings.verbosityFor("sandbox"), Verbosity::Quiet);
  EXPECT_EQ(parsed.settings.verbosityFor("default"), Verbosity::Info);
}

TEST(LogSettingsParse, LastSettingOfACategoryWins) {
  auto parsed = parseLogSettings("rg=debug,rg=info,debug,error", "TENON_LOG");
  EXPECT_EQ(parsed.settings.verbosityFor("rg"), Verbosity::Info);
  EXPECT_EQ(parsed.settings.everywhere, Verbosity::Quiet);
}

TEST(LogSettingsParse, EmptyTextAndEmptyItemsAreQuiet) {
  for (const char* text : {"", ",", " , ,"}) {
    auto parsed = parseLogSettings(text, "TENON_LOG");
    EXPECT_TRUE(parsed.problems.empty()) << text;
    EXPECT_EQ(parsed.settings.everywhere, Verbosity::Quiet) << text;
    EXPECT_TRUE(parsed.settings.categories.empty()) << text;
  }
}

TEST(LogSettingsParse, BadItemsAreSkippedAndNamed) {
  auto parsed =
      parseLogSettings("ops=loud,net=debug,verbose,Info,traffic=info,=debug", "TENON_LOG");
  EXPECT_EQ(parsed.settings.verbosityFor("traffic"), Verbosity::Info);
  EXPECT_EQ(parsed.settings.verbosityFor("ops"), Verbosity::Quiet);
  EXPECT_EQ(parsed.settings.everywhere, Verbosity::Quiet);
  EXPECT_EQ(parsed.problems,
            (std::vector<std::string>{
                "TENON_LOG: unknown level \"loud\" in \"ops=loud\", ignored",
                "TENON_LOG: unknown category \"net\" in \"net=debug\", ignored",
                "TENON_LOG: unknown level \"verbose\", ignored",
                "TENON_LOG: unknown level \"Info\", ignored",
                "TENON_LOG: unknown category \"\" in \"=debug\", ignored",
            }));
}

TEST(LogSettingsParse, DebugImpliesInfo) {
  auto bit = [](Level level) { return 1u << static_cast<unsigned>(level); };
  unsigned debug = enabledLevelMask(Verbosity::Debug);
  unsigned info = enabledLevelMask(Verbosity::Info);
  unsigned quiet = enabledLevelMask(Verbosity::Quiet);
  EXPECT_EQ(debug, bit(Level::Default) | bit(Level::Info) | bit(Level::Debug) | bit(Level::Error));
  EXPECT_EQ(info, bit(Level::Default) | bit(Level::Info) | bit(Level::Error));
  EXPECT_EQ(quiet, bit(Level::Default) | bit(Level::Error));
}

// --- configure() on live log objects ---

using ConfigureTest = LogTest;

TEST_F(ConfigureTest, NamedCategoryGetsDebugAndInfoOthersStayQuiet) {
  configure("ops=debug");
  EXPECT_TRUE(ops().enabled(Level::Debug));
  EXPECT_TRUE(ops().enabled(Level::Info));
  for (Log* other : {&traffic(), &extension(), &rg(), &sandbox(), &defaultLog()}) {
    EXPECT_FALSE(other->enabled(Level::Info)) << other->category();
    EXPECT_FALSE(other->enabled(Level::Debug)) << other->category();
  }
}

TEST_F(ConfigureTest, NewSettingsReplaceOldOnesAndReachLaterObjects) {
  configure("debug");
  EXPECT_TRUE(rg().enabled(Level::Debug));
  auto later = createLog(kSubsystem, "rg");
  ASSERT_TRUE(later);
  EXPECT_TRUE(later->enabled(Level::Debug));

  configure("sandbox=info");
  EXPECT_FALSE(rg().enabled(Level::Info));
  EXPECT_FALSE(later->enabled(Level::Info));
  EXPECT_TRUE(sandbox().enabled(Level::Info));
  EXPECT_FALSE(sandbox().enabled(Level::Debug));
}

TEST_F(ConfigureTest, BadTokensAreReportedOnceOnTheDefaultLog) {
  auto problems = configure("ops=loud,sandbox=info,net=debug");
  EXPECT_EQ(problems.size(), 2u);
  EXPECT_TRUE(sandbox().enabled(Level::Info));
  EXPECT_EQ(capture_->count("default", Level::Error, "\"loud\""), 1u);
  EXPECT_EQ(capture_->count("default", Level::Error, "\"net\""), 1u);
  EXPECT_EQ(capture_->records().size(), 2u);

  // Using the logs afterwards reports nothing more.
  TN_LOG_DEBUG(ops(), "still off");
  TN_LOG_INFO(sandbox(), "on");
  EXPECT_EQ(capture_->count("default", Level::Error, ""), 2u);
}

// --- TENON_LOG, read at first use ---

// A fresh process (the threadsafe death test style re-runs this program for
// the child) where nothing has logged yet, so the first use really is first.
TEST(LogEnvironmentDeathTest, TenonLogIsReadOnceAtFirstUseAndBadTokensReported) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  ::setenv("TENON_LOG", "traffic=debug,bogus,ops=info", 1);
  EXPECT_EXIT(
      {
        ScopedCaptureSink capture;  // installing a sink is not a use of a log
        bool ok = traffic().enabled(Level::Debug) && ops().enabled(Level::Info) &&
                  !ops().enabled(Level::Debug) && !rg().enabled(Level::Info);
        ok = ok && capture->count("default", Level::Error, "\"bogus\"") == 1;
        ::setenv("TENON_LOG", "rg=debug", 1);
        ok = ok && !rg().enabled(Level::Debug) && !defaultLog().enabled(Level::Debug);
        ok = ok && capture->records().size() == 1;
        std::_Exit(ok ? 0 : 1);
      },
      ::testing::ExitedWithCode(0), "");
  ::unsetenv("TENON_LOG");
}

}  // namespace
}  // namespace tn::log
