// The current locale and its changes: the configuration file beats the
// environment, values are reduced to language and region, and a watcher
// hears of real changes however the file is written.

#include <gtest/gtest.h>

#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <mutex>

#include "platform/dispatch/Semaphore.h"
#include "platform/locale/Locale.h"
#include "tests/support/TempDirectory.h"

namespace locale {
namespace {

class Locale : public ::testing::Test {
 protected:
  void SetUp() override {
    for (const char* key : {"LC_ALL", "LC_MESSAGES", "LANG"}) ::unsetenv(key);
  }

  // Replaces the file the way configuration tools do: a new file renamed
  // over the old one.
  void configure(const std::string& text) {
    std::filesystem::create_directories(root_ + "/etc");
    const std::string temporary = root_ + "/etc/.locale.conf.new";
    std::ofstream(temporary, std::ofstream::binary) << text;
    std::filesystem::rename(temporary, localeConfigurationPath());
  }

  tn::test::TempRoot temp_;
  const std::string& root_ = temp_.path();
};

TEST_F(Locale, ValuesAreReducedToLanguageAndRegion) {
  EXPECT_EQ(normalizedLocale("de_DE.UTF-8@euro"), "de_DE");
  EXPECT_EQ(normalizedLocale("fr"), "fr");
  EXPECT_EQ(normalizedLocale("C.UTF-8"), "en");
  EXPECT_EQ(normalizedLocale("POSIX"), "en");
  EXPECT_EQ(normalizedLocale(""), "en");
  EXPECT_EQ(localeFallbacks("de_DE"), (std::vector<std::string>{"de_DE", "de"}));
  EXPECT_EQ(localeFallbacks("fr"), (std::vector<std::string>{"fr"}));
}

TEST_F(Locale, TheConfigurationFileBeatsTheEnvironmentInPrecedenceOrder) {
  EXPECT_EQ(currentLocale(), "en");
  ::setenv("LANG", "es_ES.UTF-8", 1);
  EXPECT_EQ(currentLocale(), "es_ES");
  ::setenv("LC_ALL", "it_IT", 1);
  EXPECT_EQ(currentLocale(), "it_IT");

  configure("# system locale\nLANG=\"de_DE.UTF-8\"\n");
  EXPECT_EQ(currentLocale(), "de_DE");
  configure("LANG=de_DE.UTF-8\nLC_MESSAGES='fr_FR'\n");
  EXPECT_EQ(currentLocale(), "fr_FR");
  configure("garbage without equals\nLC_ALL=\n");
  EXPECT_EQ(currentLocale(), "it_IT") << "nothing usable in the file: the environment counts";
}

TEST_F(Locale, AWatcherHearsEachRealChangeOnceOnItsQueue) {
  configure("LANG=en_US.UTF-8\n");
  auto queue = tn::dispatch::SerialQueue::create("locale-test");
  std::mutex mutex;
  std::vector<std::string> heard;
  tn::dispatch::Semaphore changed;
  auto watcher = LocaleWatcher::create(queue, [&](const std::string& now) {
    queue->assertOnQueue();
    {
      const std::lock_guard lock(mutex);
      heard.push_back(now);
    }
    changed.signal();
  });
  ASSERT_TRUE(watcher.ok()) << watcher.error().description();

  configure("LANG=en_US.UTF-8\n# rewritten, same locale\n");
  configure("LANG=de_DE.UTF-8\n");
  ASSERT_TRUE(changed.waitFor(std::chrono::seconds(10)));
  configure("LANG=fr\n");
  ASSERT_TRUE(changed.waitFor(std::chrono::seconds(10)));
  std::filesystem::remove(localeConfigurationPath());  // back to the environment: "en"
  ASSERT_TRUE(changed.waitFor(std::chrono::seconds(10)));
  queue->sync([] {});
  const std::lock_guard lock(mutex);
  EXPECT_EQ(heard, (std::vector<std::string>{"de_DE", "fr", "en"}));
}

TEST_F(Locale, AWatcherStartsWhenTheConfigurationDirectoryIsMissing) {
  auto queue = tn::dispatch::SerialQueue::create("locale-test");
  tn::dispatch::Semaphore changed;
  auto watcher = LocaleWatcher::create(queue, [&](const std::string&) { changed.signal(); });
  ASSERT_TRUE(watcher.ok());
  EXPECT_TRUE(std::filesystem::is_directory(root_ + "/etc"));
  configure("LANG=ja_JP.UTF-8\n");
  EXPECT_TRUE(changed.waitFor(std::chrono::seconds(10)));
}

}  // namespace
}  // namespace locale
