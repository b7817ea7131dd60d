// The discovery query of the database: the election filter read from a
// host's rules, and findPlugIns over a real registrar.

#include <gtest/gtest.h>

#include <algorithm>

#include "tenond/database/ElectionFilter.h"
#include "tests/platform/bundle/BundleTestSupport.h"
#include "tests/tenond/database/DatabaseTestSupport.h"

namespace tnd::test {
namespace {

using tn::Array;
using tn::Dictionary;
using tn::Value;

Value rulesWithElection(Value election) { return Value(Dictionary{{"XTUserElection", std::move(election)}}); }

TEST(ElectionFilter, KeepsOnlyWhatItUnderstandsAndOneStrangeElementDropsTheWholeFilter) {
  EXPECT_EQ(electionFilterOf(rulesWithElection(Value("1"))), ElectionFilter{"1"});
  EXPECT_EQ(electionFilterOf(rulesWithElection(Value(Array{Value("0"), Value("=2")}))),
            (ElectionFilter{"0", "2"}));
  EXPECT_EQ(electionFilterOf(rulesWithElection(Value(Array{}))), ElectionFilter{}) << "an empty list keeps nothing";
  EXPECT_FALSE(electionFilterOf(rulesWithElection(Value(Array{Value("1"), Value(">0")}))));
  for (const Value& strange : {Value(">0"), Value(""), Value("<1"), Value("!1"), Value(1), Value(Dictionary{})}) {
    EXPECT_FALSE(electionFilterOf(rulesWithElection(strange))) << strange.description();
  }
  EXPECT_FALSE(electionFilterOf(Value(Dictionary{{"XTExtensionIdentifier", "a.b"}})));
  EXPECT_FALSE(electionFilterOf(Value()));
}

TEST(ElectionFilter, ACandidatesElectionIsTheLowByteOfTheStoredOneOrItsAutoElectDefault) {
  const Value autoElect(Dictionary{{TNDatabase::kAutoElectEntitlement, true}});
  EXPECT_EQ(candidateElection(Value(1), Value()), "1");
  EXPECT_EQ(candidateElection(Value(-1), Value()), "255");
  EXPECT_EQ(candidateElection(Value(0x102), Value()), "2") << "bits above the low byte do not count";
  EXPECT_EQ(candidateElection(Value(0), autoElect), "0") << "a stored election stands";
  EXPECT_EQ(candidateElection(Value(), autoElect), "1");
  EXPECT_EQ(candidateElection(Value(), Value(Dictionary{{TNDatabase::kAutoElectEntitlement, "yes"}})), "0")
      << "only a true number elects";
  EXPECT_EQ(candidateElection(Value("1"), Value()), "0") << "a stored election that is no number is none";
  EXPECT_EQ(candidateElection(Value(std::nan("")), Value()), "0");
  EXPECT_EQ(candidateElection(Value(1e300), Value()), "0");
}

TEST(ElectionFilter, TheAnnotationKeyIsTheReplacementWhenItIsAString) {
  EXPECT_EQ(annotationKeyOf("a.b", Value()), "a.b");
  EXPECT_EQ(annotationKeyOf("a.b", Value(Dictionary{{TNDPlugIn::kReplacePlugInEntitlement, "c.d"}})), "c.d");
  EXPECT_EQ(annotationKeyOf("a.b", Value(Dictionary{{TNDPlugIn::kReplacePlugInEntitlement, 1}})), "a.b");
}

class RegistryQuery : public ::testing::Test {
 protected:
  void open() {
    database_ = TestDatabase::open(root_.annotationsPath());
    ASSERT_TRUE(database_);
    database_->setCacheLimit(1000000);
  }
  std::vector<std::string> identifiers(const Value& rules) {
    std::vector<std::string> names;
    const auto found = database_->findPlugIns(rules);
    EXPECT_TRUE(found);
    if (found) {
      for (const auto& plugIn : *found) names.push_back(plugIn->identifier().value_or("?"));
    }
    std::sort(names.begin(), names.end());
    return names;
  }
  void elect(const std::string& bundle, Value election) {
    const auto plugIn = database_->findPlugInAtPath(tn::URL::fileURLWithPath(bundle));
    ASSERT_TRUE(plugIn) << bundle;
    database_->setAnnotation(Dictionary{{"election", std::move(election)}}, *plugIn);
  }

  DatabaseRoot root_;
  std::shared_ptr<TestDatabase> database_;
};

TEST_F(RegistryQuery, NoRulesListEveryPlugInOnceAndTheElectionNarrowsByTheStoredOrDefaultElection) {
  const std::string one = root_.makeAppWithPlugIn("One", "com.example.one");
  const std::string two = root_.makeAppWithPlugIn("Two", "com.example.two");
  const std::string three = root_.makeAppWithPlugIn("Three", "com.example.three");
  const std::string automatic = root_.makeAppWithPlugIn("Auto", "com.example.auto");
  tn::test::writeFile(automatic + "/Entitlements.manifest", R"({"com.ostrel.developer.auto-elect-plugin": true})");
  open();
  elect(one, Value(1));
  elect(two, Value(2));
  const std::vector<std::string> all{"com.example.auto", "com.example.one", "com.example.three", "com.example.two"};
  EXPECT_EQ(identifiers(Value()), all);
  EXPECT_EQ(identifiers(Value(Dictionary{})), all);
  EXPECT_EQ(identifiers(rulesWithElection(Value("1"))), (std::vector<std::string>{"com.example.auto", "com.example.one"}));
  EXPECT_EQ(identifiers(rulesWithElection(Value(Array{Value("0"), Value("=2")}))),
            (std::vector<std::string>{"com.example.three", "com.example.two"}));
  EXPECT_EQ(identifiers(rulesWithElection(Value(Array{Value("1"), Value(">0")}))), all) << "no filter at all";
}

TEST_F(RegistryQuery, AReplacementIsJudgedByTheElectionOfWhatItReplacesAndPlaceholdersAreSkipped) {
  const std::string original = root_.makeAppWithPlugIn("Original", "com.example.original");
  const std::string replacement = root_.makeAppWithPlugIn("Replacement", "com.example.replacement");
  tn::test::writeFile(replacement + "/Entitlements.manifest",
                      R"({"com.ostrel.developer.replace-plugin": "com.example.original"})");
  const std::string installing = root_.makeAppWithPlugIn("Installing", "com.example.installing");
  open();
  elect(original, Value(1));
  EXPECT_EQ(identifiers(rulesWithElection(Value("1"))),
            (std::vector<std::string>{"com.example.original", "com.example.replacement"}));

  // An application that is being installed again is a placeholder: its
  // plug-ins are not offered, even though the registrar still lists them.
  tn::test::writeFile(root_.appRoot() + "/Installing/.installing", "");
  ASSERT_TRUE(database_->workspace()->scan());
  const registrar::PlugInPtr listed = database_->workspace()->plugInForURL(tn::URL::fileURLWithPath(installing));
  ASSERT_TRUE(listed && listed->containingApp() && listed->containingApp()->isPlaceholder());
  const auto found = identifiers(Value());
  EXPECT_EQ(std::count(found.begin(), found.end(), "com.example.installing"), 0);
}

}  // namespace
}  // namespace tnd::test
