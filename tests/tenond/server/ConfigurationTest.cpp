// The daemon's configuration document: defaults when it is missing, the keys
// of a trusted document, and an error line plus the default for everything
// that cannot be believed or understood.

#include "tenond/server/TNDConfiguration.h"

#include <gtest/gtest.h>

#include <unistd.h>

#include "platform/log/Log.h"
#include "tests/platform/bundle/BundleTestSupport.h"

namespace tnd {
namespace {

class Configuration : public ::testing::Test {
 protected:
  void write(std::string_view contents, mode_t mode = 0644) { tn::test::writeFile(path_, contents, mode); }
  bool logged(std::string_view text) const {
    for (const std::string& line : capture_->lines())
      if (line.starts_with("ops error") && line.find(path_) != std::string::npos &&
          line.find(text) != std::string::npos)
        return true;
    return false;
  }

  tn::test::TempRoot root_;
  std::string path_ = root_ / "etc/tenon/tenond.manifest";
  tn::log::ScopedCaptureSink capture_;
};

TEST_F(Configuration, AMissingDocumentMeansDefaults) {
  EXPECT_EQ(TNDConfiguration::path(), path_);
  const TNDConfiguration configuration = TNDConfiguration::load();
  EXPECT_TRUE(configuration.privilegedGroups.empty());
  EXPECT_FALSE(configuration.connectionsPerUser);
  EXPECT_FALSE(configuration.connectionsTotal);
  EXPECT_TRUE(capture_->lines().empty());
}

TEST_F(Configuration, ATrustedDocumentGivesEveryKeyGroupsByNameOrNumber) {
  write(R"({"privileged-groups": ["root", 4242], "connections-per-user": 8, "connections-total": 100,)"
        R"( "termination-grace-seconds": 30})");
  const TNDConfiguration configuration = TNDConfiguration::load();
  EXPECT_EQ(configuration.terminationGraceSeconds, 30u);
  EXPECT_EQ(configuration.privilegedGroups, (std::vector<gid_t>{0, 4242}));
  EXPECT_EQ(configuration.connectionsPerUser, 8u);
  EXPECT_EQ(configuration.connectionsTotal, 100u);
  EXPECT_TRUE(capture_->lines().empty());

  // XML documents are read too.
  write(R"(<?xml version="1.0" encoding="UTF-8"?><tenon-document version="1"><map>)"
        R"(<item key="connections-total"><int>5</int></item></map></tenon-document>)");
  EXPECT_EQ(TNDConfiguration::load().connectionsTotal, 5u);
}

TEST_F(Configuration, AnUntrustedDocumentIsIgnored) {
  if (::geteuid() != 0) GTEST_SKIP() << "the trust rule is about owners; the test files must be root's";
  write(R"({"privileged-groups": [4242]})", 0664);
  EXPECT_TRUE(TNDConfiguration::load().privilegedGroups.empty());
  EXPECT_TRUE(logged("writable by group or others (mode 0664)"));
}

TEST_F(Configuration, AMalformedDocumentIsIgnored) {
  write(R"({"privileged-groups": [4242)");
  EXPECT_TRUE(TNDConfiguration::load().privilegedGroups.empty());
  EXPECT_TRUE(logged("ignored"));
  capture_->clear();
  write(R"([4242])");
  EXPECT_TRUE(TNDConfiguration::load().privilegedGroups.empty());
  EXPECT_TRUE(logged("not a dictionary"));
}

// Each bad key falls back to its own default; the good ones still count.
TEST_F(Configuration, AKeyOfTheWrongTypeGetsItsDefault) {
  write(R"({"privileged-groups": "wheel", "connections-per-user": 0, "connections-total": 7,)"
        R"( "termination-grace-seconds": 86400})");
  TNDConfiguration configuration = TNDConfiguration::load();
  EXPECT_FALSE(configuration.terminationGraceSeconds);
  EXPECT_TRUE(logged("\"termination-grace-seconds\" is more than 3600"));
  EXPECT_TRUE(configuration.privilegedGroups.empty());
  EXPECT_FALSE(configuration.connectionsPerUser);
  EXPECT_EQ(configuration.connectionsTotal, 7u);
  EXPECT_TRUE(logged("\"privileged-groups\" is not an array"));
  EXPECT_TRUE(logged("\"connections-per-user\" is not a positive integer"));

  capture_->clear();
  write(R"({"privileged-groups": [4242, "no-such-group-here"], "connections-total": "many", "colour": 1})");
  configuration = TNDConfiguration::load();
  EXPECT_TRUE(configuration.privilegedGroups.empty()) << "one unknown group voids the key";
  EXPECT_FALSE(configuration.connectionsTotal);
  EXPECT_TRUE(logged("no-such-group-here"));
  EXPECT_TRUE(logged("\"connections-total\" is not a positive integer"));
  EXPECT_TRUE(logged("unknown key \"colour\""));

  capture_->clear();
  write(R"({"privileged-groups": [-1, 4294967295]})");
  EXPECT_TRUE(TNDConfiguration::load().privilegedGroups.empty());
  EXPECT_TRUE(logged("names no group"));
}

}  // namespace
}  // namespace tnd
