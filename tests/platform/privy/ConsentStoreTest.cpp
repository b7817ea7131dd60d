// The consent store: decisions recorded and answered per application, the
// trust rule on reading, who may change it, bounds, and concurrent writers.

#include <gtest/gtest.h>

#include <grp.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <thread>

#include "platform/log/CaptureSink.h"
#include "platform/privy/ConsentStore.h"
#include "tests/platform/bundle/BundleTestSupport.h"

namespace privy {
namespace {

class Consent : public ::testing::Test {
 protected:
  std::string path() const { return root_.path() + "/var/lib/tenon/consent.manifest"; }
  ConsentStore store() const { return ConsentStore(path(), ::geteuid()); }

  tn::test::TempDirectory root_;
};

TEST_F(Consent, DecisionsAreRecordedPerApplicationAndOnlyGrantsCount) {
  EXPECT_TRUE(store().allowedServices("com.example.photos").empty());  // no file yet
  ASSERT_TRUE(store().setConsent("com.example.photos", "com.ostrel.privy.camera", true).ok());
  ASSERT_TRUE(store().setConsent("com.example.photos", "com.ostrel.privy.location", false).ok());
  ASSERT_TRUE(store().setConsent("com.example.notes", "com.ostrel.privy.contacts", true).ok());
  EXPECT_EQ(store().allowedServices("com.example.photos"), std::set<std::string>{"com.ostrel.privy.camera"});
  EXPECT_EQ(store().allowedServices("com.example.notes"), std::set<std::string>{"com.ostrel.privy.contacts"});
  EXPECT_TRUE(store().allowedServices("com.example.unknown").empty());
  EXPECT_FALSE(store().recordsForApplication("not an identifier"));

  ASSERT_TRUE(store().setConsent("com.example.photos", "com.ostrel.privy.camera", false).ok());  // revoked
  EXPECT_TRUE(store().allowedServices("com.example.photos").empty());
  EXPECT_EQ(*store().recordsForApplication("com.example.photos"),
            (std::vector<ConsentRecord>{{"com.ostrel.privy.camera", false}, {"com.ostrel.privy.location", false}}));

  struct stat status {};
  ASSERT_EQ(::stat(path().c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0644u);
  ASSERT_EQ(::stat((root_.path() + "/var/lib").c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0755u);  // whatever the umask

  EXPECT_EQ(store().setConsent("com.example.photos", "bad service", true).error().code(),
            static_cast<int64_t>(PrivyErrorCode::InvalidArgument));
}

TEST_F(Consent, HandWrittenRecordsWithoutATrueGrantContributeNothing) {
  tn::test::writeFile(path(), R"({"version": 1, "applications": {"com.example.a": [
      {"service": "s.true", "granted": true}, {"service": "s.one", "granted": 1}, {"service": "s.false", "granted": false},
      {"service": "s.missing"}, {"service": "s.string", "granted": "yes"}, {"granted": true}, "s.bare",
      {"service": "bad service", "granted": true}], "bad app": [{"service": "s.x", "granted": true}]}})");
  EXPECT_EQ(store().allowedServices("com.example.a"), (std::set<std::string>{"s.true", "s.one"}));
  ASSERT_TRUE(store().read().ok());
  EXPECT_EQ(store().read()->size(), 1u);
}

TEST_F(Consent, AnUntrustedOrMalformedStoreGrantsNothing) {
  tn::test::writeFile(path(), R"({"applications": {"com.example.a": [{"service": "s", "granted": true}]}})", 0666);
  tn::log::ScopedCaptureSink capture;
  EXPECT_TRUE(store().allowedServices("com.example.a").empty());
  EXPECT_TRUE(capture->contains("ops", tn::log::Level::Error, "consent store ignored, nothing is granted: " + path() +
                                                                  ": not trusted: writable by group or others"));
  EXPECT_EQ(store().read().error().code(), static_cast<int64_t>(PrivyErrorCode::Untrusted));
  // A store the daemon cannot trust is not merged into: the change is refused.
  EXPECT_EQ(store().setConsent("com.example.a", "s", true).error().code(),
            static_cast<int64_t>(PrivyErrorCode::Untrusted));
  // Trusted for root, but not for a daemon running as another user.
  ASSERT_EQ(::chmod(path().c_str(), 0644), 0);
  EXPECT_EQ(store().allowedServices("com.example.a"), std::set<std::string>{"s"});
  EXPECT_TRUE(ConsentStore(path(), 0).allowedServices("com.example.a").size() == 1);

  tn::test::writeFile(path(), "{\"applications\": ");
  EXPECT_TRUE(store().allowedServices("com.example.a").empty());
  EXPECT_EQ(store().read().error().code(), static_cast<int64_t>(PrivyErrorCode::Unreadable));
}

TEST_F(Consent, OnlyRootOrTheStoresOwnerMayChangeIt) {
  ASSERT_EQ(::geteuid(), 0u) << "the test drops to another user";
  ASSERT_TRUE(store().setConsent("com.example.a", "s", true).ok());
  ASSERT_EQ(::chmod(root_.path().c_str(), 0755), 0);  // so that the other user can look
  const pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    if (::setgroups(0, nullptr) != 0 || ::setgid(65534) != 0 || ::setuid(65534) != 0) ::_exit(10);
    const tn::Result<void> changed = ConsentStore(path(), 0).setConsent("com.example.a", "s", false);
    if (changed.ok()) ::_exit(11);
    if (changed.error().code() != static_cast<int64_t>(PrivyErrorCode::NotPermitted)) ::_exit(12);
    if (changed.error().localizedDescription().find("only root or the daemon's user can change consent") ==
        std::string::npos) {
      ::_exit(13);
    }
    // Reading is for everyone.
    ::_exit(ConsentStore(path(), 0).allowedServices("com.example.a").size() == 1 ? 0 : 14);
  }
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0);
}

TEST_F(Consent, BoundsAndConcurrentWriters) {
  std::string many = R"({"applications": {"com.example.full": [)";
  for (size_t i = 0; i < kMaxServicesPerApplication; ++i) many += fmt::format(R"({}{{"service": "s{}", "granted": true}})", i ? "," : "", i);
  tn::test::writeFile(path(), many + "]}}");
  EXPECT_EQ(store().setConsent("com.example.full", "one.more", true).error().code(),
            static_cast<int64_t>(PrivyErrorCode::TooLarge));
  EXPECT_TRUE(store().setConsent("com.example.full", "s3", false).ok());  // a change, not an addition

  std::vector<std::thread> writers;
  for (int writer = 0; writer < 2; ++writer) {
    writers.emplace_back([this, writer] {
      for (int i = 0; i < 8; ++i) EXPECT_TRUE(store().setConsent("com.example.busy", fmt::format("w{}.s{}", writer, i), true).ok());
    });
  }
  for (std::thread& writer : writers) writer.join();
  EXPECT_EQ(store().allowedServices("com.example.busy").size(), 16u);  // no write lost
  EXPECT_EQ(store().allowedServices("com.example.full").size(), kMaxServicesPerApplication - 1);
}

}  // namespace
}  // namespace privy
