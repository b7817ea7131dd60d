// The registry's reading of rules: it may only leave out plug-ins that the
// daemon's matching certainly refuses.

#include <gtest/gtest.h>

#include "platform/registrar/QueryNarrowing.h"

namespace registrar {
namespace {

PlugInRecord plugIn(std::string identifier, tn::Value attributes, tn::Value info = tn::Dictionary()) {
  PlugInRecord::Fields fields;
  fields.identifier = std::move(identifier);
  fields.bundlePath = "/opt/A/Support/PlugIns/P";
  fields.plugInDictionary = tn::Dictionary{{"XTExtensionAttributes", std::move(attributes)}};
  fields.infoDictionary = std::move(info);
  return PlugInRecord(std::move(fields));
}

TEST(QueryNarrowing, EqualityKeysIgnoreLeadingZerosOnly) {
  EXPECT_EQ(equalityKey("a007.010b"), "a7.10b");
  EXPECT_EQ(equalityKey("000"), "0");
  EXPECT_EQ(equalityKey("Abc"), "Abc");
  EXPECT_NE(equalityKey("abc"), equalityKey("Abc"));
  EXPECT_EQ(equalityOperand(tn::Value("=x")), "x");
  EXPECT_EQ(equalityOperand(tn::Value("x")), "x");
  EXPECT_EQ(equalityOperand(tn::Value("=")), "");
  EXPECT_FALSE(equalityOperand(tn::Value("<>x")));
  EXPECT_FALSE(equalityOperand(tn::Value(">=1")));
  EXPECT_FALSE(equalityOperand(tn::Value("?TY-IS:application/octet-stream")));
}

TEST(QueryNarrowing, UnderstoodEntriesNarrowExactly) {
  const PlugInRecord p = plugIn("com.example.p", tn::Dictionary{{"Kind", tn::Array{"a", "b"}}, {"Off", 0}},
                                tn::Dictionary{{"TopLevel", "yes"}});
  const auto may = [&](tn::Dictionary rules) { return mayMatch(tn::Value(std::move(rules)), p); };
  EXPECT_TRUE(may({}));
  EXPECT_TRUE(may({{"XTExtensionIdentifier", "com.example.p"}}));
  EXPECT_FALSE(may({{"XTExtensionIdentifier", "com.example.q"}}));
  EXPECT_TRUE(may({{"Kind", "b"}}));                    // any element of an array value
  EXPECT_TRUE(may({{"Kind", tn::Array{"z", "=a"}}}));   // any of the patterns
  EXPECT_FALSE(may({{"Kind", tn::Array{}}}));           // an empty any-of matches nothing
  EXPECT_FALSE(may({{"Kind", "c"}}));
  EXPECT_TRUE(may({{"TopLevel", "yes"}}));              // falls back to the information dictionary
  EXPECT_FALSE(may({{"Off", true}}));                   // 0 is false: not present
  EXPECT_TRUE(may({{"Off", false}}));
  EXPECT_TRUE(may({{"Absent", false}}));
  EXPECT_FALSE(may({{"Absent", true}}));
  EXPECT_FALSE(may({{"Absent", "x"}}));
  EXPECT_FALSE(may({{"Kind", "b"}, {"Absent", "x"}}));  // every entry must hold
}

TEST(QueryNarrowing, EverythingElseIsLeftToTheDaemon) {
  const PlugInRecord p = plugIn("com.example.p", tn::Dictionary{{"Version", "1.9"}});
  const auto may = [&](tn::Dictionary rules) { return mayMatch(tn::Value(std::move(rules)), p); };
  EXPECT_TRUE(may({{"Version", ">=1.10"}}));
  EXPECT_TRUE(may({{"Version", tn::Array{"2", "<1"}}}));
  EXPECT_TRUE(may({{"XTExtensionIdentifier", "<>com.example.p"}}));
  EXPECT_TRUE(may({{"XTUserElection", "1"}}));
  EXPECT_TRUE(may({{"com.ostrel.uuid", "nonsense"}}));
  EXPECT_TRUE(may({{"XTExtensionContainingApp", "/elsewhere"}}));
  EXPECT_TRUE(may({{"ENTITLEMENT:com.example.e", true}}));
  EXPECT_TRUE(may({{"Version", tn::Dictionary{{"rule", 1}}}}));  // activation rules
  EXPECT_TRUE(may({{"Version", "01.009"}}));  // digit runs may compare equal
  EXPECT_TRUE(identifierKeys(tn::Dictionary{{"XTExtensionIdentifier", tn::Array{"a01", 3}}}) ==
              (std::vector<std::string>{"a1"}));
  EXPECT_FALSE(identifierKeys(tn::Dictionary{{"XTExtensionIdentifier", tn::Array{"a", ">b"}}}));
  EXPECT_FALSE(identifierKeys(tn::Dictionary{{"Kind", "a"}}));
}

}  // namespace
}  // namespace registrar
