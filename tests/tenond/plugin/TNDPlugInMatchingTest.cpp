// Rules dictionaries against real daemon plug-in records: every key source,
// every pattern kind, the operators in their order with the numeric string
// comparison, type conformance over the system's shared MIME database, the
// election value, activation rules and the bounds on work.

#include <gtest/gtest.h>

#include <map>

#include "platform/log/CaptureSink.h"
#include "platform/types/TypeSources.h"
#include "tests/tenond/database/DatabaseTestSupport.h"

namespace tnd::test {
namespace {

using tn::Array;
using tn::Dictionary;
using tn::Value;

class Matching : public ::testing::Test {
 protected:
  void SetUp() override {
    context_.types = types::loadTypeTable(types::TypePaths::forRoot("", "/usr/share"));
    context_.annotationForPlugIn = [this](const TNDPlugIn& plugIn) -> std::optional<Dictionary> {
      auto found = annotations_.find(plugIn.annotationKey());
      if (found == annotations_.end()) return std::nullopt;
      return found->second;
    };
    tn::log::extension().setEnabledLevels(~0u);
  }
  void open() {
    registrar_ = root_.open(registrar::test::quiet());
    ASSERT_TRUE(registrar_);
    lookup_ = std::make_unique<tn::RegistrarLookup>(registrar_);
  }
  // A plug-in in an application, with attributes (a JSON object's text).
  std::shared_ptr<TNDPlugIn> plugIn(const std::string& identifier, const std::string& attributes = "{}",
                                    const Value& entitlements = Value(Dictionary{})) {
    const std::string bundle = root_.makeAppWithPlugIn(identifier, identifier,
                                                       R"(, "XTExtensionAttributes": )" + attributes);
    if (!registrar_) open();
    EXPECT_TRUE(registrar_->scan().ok());
    const registrar::PlugInPtr record = registrar_->plugInForURL(tn::URL::fileURLWithPath(bundle));
    EXPECT_TRUE(record);
    auto built = daemonRecord(record, registrar_, *lookup_, entitlements, record->dataContainerPath());
    EXPECT_TRUE(built);
    return built;
  }
  bool match(const TNDPlugIn& p, const Value& rules) const { return p.match(rules, context_); }
  bool entry(const TNDPlugIn& p, std::string_view key, const Value& pattern) const {
    return p.match(Value(Dictionary{{std::string(key), pattern}}), context_);
  }
  bool compare(std::string_view value, std::string_view pattern) const {
    return TNDPlugIn::matchValue(value, pattern, context_);
  }

  DatabaseRoot root_;
  std::shared_ptr<registrar::Registrar> registrar_;
  std::unique_ptr<tn::RegistrarLookup> lookup_;
  TNDMatchContext context_;
  std::map<std::string, Dictionary> annotations_;
};

TEST_F(Matching, OperatorsInTheirPrefixOrderWithTheNumericComparison) {
  EXPECT_TRUE(compare("1.10", ">1.9"));  // digit runs compare as numbers
  EXPECT_FALSE(compare("1.10", "<=1.9"));
  EXPECT_TRUE(compare("10", ">9"));
  EXPECT_TRUE(compare("1.9", "<1.10"));
  EXPECT_TRUE(compare("2", ">=2"));
  EXPECT_TRUE(compare("2", "<=2"));
  EXPECT_FALSE(compare("2", "<2"));
  EXPECT_FALSE(compare("2", ">2"));
  EXPECT_TRUE(compare("a.c", "<>a.b"));   // "<>" is taken before "<"
  EXPECT_FALSE(compare("a.b", "<>a.b"));
  EXPECT_TRUE(compare("<x", "=<x"));      // "=" takes the rest as the operand
  EXPECT_TRUE(compare("", "="));          // "=" alone matches only the empty string
  EXPECT_FALSE(compare("a", "="));
  EXPECT_TRUE(compare("abc", "abc"));     // no operator: sameness
  EXPECT_FALSE(compare("ABC", "abc"));    // case counts
  EXPECT_TRUE(compare("v01", "v1"));      // leading zeros do not count in digit runs
  EXPECT_TRUE(compare("1.5", "<2"));
}

TEST_F(Matching, TypeOperatorsOverTheSharedMimeDatabaseAndUnknownOperators) {
  ASSERT_GT(context_.types->size(), 100u) << "the shared MIME database (shared-mime-info) is missing";
  EXPECT_TRUE(compare("image/svg+xml", "?TY-CONFORMS:application/xml"));
  EXPECT_TRUE(compare("image/svg+xml", "?TY-CONFORMS:text/xml"));  // an alias
  EXPECT_FALSE(compare("image/svg+xml", "?TY-IS:application/xml"));
  EXPECT_TRUE(compare("application/xml", "?TY-IS:image/svg+xml"));
  EXPECT_TRUE(compare("image/png", "?TY-CONFORMS:image/*"));
  EXPECT_FALSE(compare("image/png", "?TY-CONFORMS:"));

  tn::log::ScopedCaptureSink capture;
  EXPECT_FALSE(compare("image/png", "?TY-SOMETHING:image/png"));
  EXPECT_FALSE(compare("?", "?"));
  EXPECT_TRUE(capture->contains("ops", tn::log::Level::Info, "unrecognized match operator:?TY-SOMETHING:image/png"));
  EXPECT_EQ(capture->lines().size(), 2u);
}

TEST_F(Matching, KeySourcesAndTheirFallbacks) {
  const auto p = plugIn("com.example.keys", R"({"Kind": "thumb", "BNBundleName": "from-attributes"})",
                        Value(Dictionary{{"com.example.ent", Value("yes")}, {"com.example.off", Value(false)}}));
  EXPECT_TRUE(entry(*p, "XTExtensionIdentifier", Value("com.example.keys")));
  EXPECT_TRUE(entry(*p, "XTExtensionIdentifier", Value("<>a.b")));
  EXPECT_TRUE(entry(*p, "com.ostrel.uuid", Value(p->uuid()->string())));
  EXPECT_TRUE(entry(*p, "XTExtensionContainingApp", Value(*p->containingPath())));
  EXPECT_TRUE(entry(*p, "Kind", Value("thumb")));
  EXPECT_TRUE(entry(*p, "BNBundleName", Value("from-attributes")));  // the attribute wins
  EXPECT_TRUE(entry(*p, "BNBundleVersion", Value("1")));             // else the manifest's own
  EXPECT_TRUE(entry(*p, "ENTITLEMENT:com.example.ent", Value(true)));
  EXPECT_TRUE(entry(*p, "ENTITLEMENT:com.example.ent", Value("yes")));
  EXPECT_FALSE(entry(*p, "ENTITLEMENT:com.example.off", Value(true)));
  EXPECT_TRUE(entry(*p, "ENTITLEMENT:com.example.off", Value(false)));
  EXPECT_FALSE(entry(*p, "ENTITLEMENT:Kind", Value(true)));  // entitlements never fall back

  // A loose plug-in on the system volume has no containing application:
  // that key fails whatever the pattern, even the absence test.
  const std::string loose = root_.path() + "/System/Library/Loose.bundle";
  registrar::test::PlatformRoot::writePlugIn(loose, "com.example.loose", "1");
  ASSERT_TRUE(registrar_->registerPlugIn(tn::URL::fileURLWithPath(loose)).ok());
  const auto loosePlugIn = TNDPlugIn::initWithRGData(registrar_->plugInForURL(tn::URL::fileURLWithPath(loose)),
                                                     registrar_, *lookup_);
  ASSERT_TRUE(loosePlugIn);
  EXPECT_FALSE(entry(*loosePlugIn, "XTExtensionContainingApp", Value(false)));
  EXPECT_FALSE(entry(*loosePlugIn, "XTExtensionContainingApp", Value(true)));
  EXPECT_TRUE(entry(*loosePlugIn, "NotThere", Value(false)));
}

TEST_F(Matching, PresenceAbsenceAndArrays) {
  const auto p = plugIn("com.example.flags",
                        R"({"One": 1, "Text": "x", "Zero": 0, "Off": false, "Real": 1.0,
                            "Types": ["text/plain", "image/png"], "Number": 3, "Mixed": [7, "b"]})");
  for (const char* present : {"One", "Text", "Real", "Types", "Number"}) {
    EXPECT_TRUE(entry(*p, present, Value(true))) << present;
    EXPECT_TRUE(entry(*p, present, Value(1))) << present;
    EXPECT_FALSE(entry(*p, present, Value(false))) << present;
  }
  for (const char* absent : {"Zero", "Off", "Missing"}) {
    EXPECT_FALSE(entry(*p, absent, Value(true))) << absent;
    EXPECT_TRUE(entry(*p, absent, Value(false))) << absent;
    EXPECT_TRUE(entry(*p, absent, Value(0))) << absent;
  }
  EXPECT_TRUE(entry(*p, "Types", Value("image/png")));  // any element
  EXPECT_FALSE(entry(*p, "Types", Value("image/gif")));
  EXPECT_TRUE(entry(*p, "Types", Value("?TY-CONFORMS:application/octet-stream")));
  EXPECT_TRUE(entry(*p, "Mixed", Value("b")));
  EXPECT_FALSE(entry(*p, "Mixed", Value("7")));  // elements that are not strings never match
  EXPECT_FALSE(entry(*p, "Number", Value("3")));  // nor do values that are not strings
  EXPECT_FALSE(entry(*p, "Number", Value(3)));
  EXPECT_FALSE(entry(*p, "Missing", Value("x")));

  const Value anyOf(Array{Value(">=2"), Value("<1")});
  EXPECT_TRUE(TNDPlugIn::matchValue("3", anyOf, context_));
  EXPECT_FALSE(TNDPlugIn::matchValue("1.5", anyOf, context_));
  EXPECT_TRUE(TNDPlugIn::matchValue("0.5", anyOf, context_));
  EXPECT_FALSE(TNDPlugIn::matchValue("x", Value(Array{}), context_));
  EXPECT_TRUE(TNDPlugIn::matchValue("x", Value(Array{Value(1), Value("x")}), context_));
  EXPECT_FALSE(TNDPlugIn::matchValue("x", Value(7), context_));
}

TEST_F(Matching, TheElectionWithBitsEightToFifteenCleared) {
  const auto p = plugIn("com.example.elected");
  EXPECT_EQ(p->electionValue(context_), "0");
  EXPECT_TRUE(entry(*p, "XTUserElection", Value("0")));
  EXPECT_FALSE(entry(*p, "XTUserElection", Value("1")));
  const std::vector<std::pair<Value, std::string>> cases = {
      {Value(1), "1"},         {Value(0x1234), "52"},        {Value(256), "0"},   {Value(0x10001), "65537"},
      {Value(-1), "-65281"},   {Value(uint64_t{0xFFFFFFFFFFFFFFFF}), "-65281"},    {Value(true), "1"},
      {Value(2.9), "2"},       {Value("1"), "0"},            {Value(), "0"}};
  for (const auto& [election, expected] : cases) {
    annotations_["com.example.elected"] = Dictionary{{"election", election}};
    EXPECT_EQ(p->electionValue(context_), expected) << election;
  }
  annotations_["com.example.elected"] = Dictionary{{"election", Value(1)}};
  EXPECT_TRUE(entry(*p, "XTUserElection", Value("1")));
  EXPECT_TRUE(entry(*p, "XTUserElection", Value(Array{Value("0"), Value("=1")})));
  EXPECT_FALSE(entry(*p, "XTUserElection", Value("0")));
  const TNDMatchContext withoutAnnotations{context_.types, {}};  // no source: every election is 0
  EXPECT_EQ(p->electionValue(withoutAnnotations), "0");
}

TEST_F(Matching, WholeRulesStopAtTheFirstFailingEntry) {
  const auto p = plugIn("com.example.rules", R"({"Kind": "thumb"})");
  EXPECT_TRUE(match(*p, Value()));
  EXPECT_TRUE(match(*p, Value(Dictionary{})));
  EXPECT_FALSE(match(*p, Value(Array{})));
  EXPECT_FALSE(match(*p, Value(Dictionary{{"Kind", Value("thumb")}, {"XTExtensionIdentifier", Value("com.example.*")}})));
  EXPECT_TRUE(match(*p, Value(Dictionary{{"Kind", Value("thumb")}, {"XTExtensionIdentifier", Value(">com")}})));

  tn::log::ScopedCaptureSink capture;
  EXPECT_FALSE(match(*p, Value(Dictionary{{"Kind", Value("other")}, {"XTExtensionIdentifier", Value("?never:evaluated")}})));
  EXPECT_FALSE(capture->contains("ops", tn::log::Level::Info, "unrecognized match operator"));
  EXPECT_FALSE(match(*p, Value(Dictionary{{"Kind", Value("thumb")}, {"XTExtensionIdentifier", Value("?now:evaluated")}})));
  EXPECT_TRUE(capture->contains("ops", tn::log::Level::Info, "unrecognized match operator:?now:evaluated"));
}

TEST_F(Matching, ActivationRulesAgainstAHostsOffer) {
  const auto p = plugIn("com.example.share",
                        R"({"XTExtensionActivationRule": {"accepts": {"image/*": 2, "text/uri-list": 1}},
                            "BrokenRule": {"accepts": "image/*"}})");
  const auto offer = [](const char* type, int count) {
    return Value(Dictionary{{"items", Value(Array{Value(Dictionary{{"type", Value(type)}, {"count", Value(count)}})})}});
  };
  tn::log::ScopedCaptureSink capture;
  EXPECT_TRUE(entry(*p, "XTExtensionActivationRule", offer("image/svg+xml", 2)));
  EXPECT_TRUE(capture->contains("extension", tn::log::Level::Debug, "evaluating XTExtension filter: {items: [{type: "));
  EXPECT_FALSE(entry(*p, "XTExtensionActivationRule", offer("image/png", 3)));
  EXPECT_FALSE(entry(*p, "XTExtensionActivationRule", offer("application/pdf", 1)));
  EXPECT_FALSE(entry(*p, "BrokenRule", offer("image/png", 1)));
  EXPECT_FALSE(entry(*p, "NoRule", offer("image/png", 1)));
  EXPECT_FALSE(entry(*p, "XTExtensionActivationRule", Value(Dictionary{{"items", Value("image/png")}})));
  EXPECT_FALSE(entry(*p, "XTExtensionIdentifier", offer("image/png", 1)));  // a string is no rule
}

TEST_F(Matching, BoundsOnRulesArraysAndWork) {
  const auto p = plugIn("com.example.bounds");
  Dictionary many;
  for (size_t i = 0; i <= TNDPlugIn::kMaxRuleEntries; ++i) many.set("Absent" + std::to_string(i), Value(false));
  EXPECT_FALSE(match(*p, Value(many)));
  many.erase("Absent0");
  EXPECT_TRUE(match(*p, Value(many)));

  Array alternatives(TNDPlugIn::kMaxMatchAlternatives, Value("no"));
  alternatives.push_back(Value("com.example.bounds"));
  EXPECT_FALSE(entry(*p, "XTExtensionIdentifier", Value(alternatives)));
  alternatives.erase(alternatives.begin());
  EXPECT_TRUE(entry(*p, "XTExtensionIdentifier", Value(alternatives)));

  // Long operands exhaust one call's work: the answer is no, with a log line.
  const Array costly(TNDPlugIn::kMaxMatchAlternatives, Value(std::string(1024, 'x')));
  tn::log::ScopedCaptureSink capture;
  EXPECT_FALSE(match(*p, Value(Dictionary{{"XTExtensionIdentifier", Value(costly)}})));
  EXPECT_TRUE(capture->contains("ops", tn::log::Level::Info, "rules too costly to match against plug-in " +
                                                                 p->uuid()->string()));
}

}  // namespace
}  // namespace tnd::test
