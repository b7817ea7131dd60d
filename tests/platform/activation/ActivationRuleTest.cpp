// Activation rules against hosts' offers: each condition's meaning, the
// type hierarchy behind it, and malformed or oversized rules and offers,
// which never match.

#include <gtest/gtest.h>

#include "platform/activation/ActivationRule.h"
#include "platform/types/TypeSources.h"
#include "platform/value/Document.h"

namespace activation {
namespace {

tn::Value json(std::string_view text) {
  tn::Result<tn::Value> value = tn::readDocument(text, "test");
  EXPECT_TRUE(value.ok()) << text;
  return value.ok() ? *value : tn::Value();
}

const types::TypeTable& systemTypes() {
  static const auto table = types::loadTypeTable(types::TypePaths::forRoot("", "/usr/share"));
  return *table;
}

Verdict verdict(std::string_view rule, std::string_view offer) {
  return evaluate(json(rule), json(offer), systemTypes()).verdict;
}

constexpr std::string_view kImagesOrALink = R"({"accepts": {"image/*": 10, "text/uri-list": 1}})";

TEST(ActivationRule, AcceptsBoundsEachTypeAndRefusesOtherItems) {
  EXPECT_EQ(verdict(kImagesOrALink, R"({"items": [{"type": "image/png", "count": 3}]})"), Verdict::Match);
  EXPECT_EQ(verdict(kImagesOrALink, R"({"items": [{"type": "image/png", "count": 4}, {"type": "image/jpeg", "count": 6}]})"),
            Verdict::Match);
  EXPECT_EQ(verdict(kImagesOrALink, R"({"items": [{"type": "image/png", "count": 11}]})"), Verdict::NoMatch);
  EXPECT_EQ(verdict(kImagesOrALink, R"({"items": [{"type": "image/png"}, {"type": "text/uri-list"}]})"), Verdict::Match);
  EXPECT_EQ(verdict(kImagesOrALink, R"({"items": [{"type": "text/uri-list", "count": 2}]})"), Verdict::NoMatch);
  EXPECT_EQ(verdict(kImagesOrALink, R"({"items": [{"type": "image/png"}, {"type": "application/pdf"}]})"),
            Verdict::NoMatch);
  EXPECT_EQ(verdict(kImagesOrALink, R"({"items": []})"), Verdict::NoMatch);
  // A zero limit accepts the type but no item of it.
  EXPECT_EQ(verdict(R"({"accepts": {"text/plain": 0}})", R"({"items": [{"type": "text/plain"}]})"), Verdict::NoMatch);
}

TEST(ActivationRule, ConformanceFollowsTheHierarchyAndAliases) {
  const std::string_view xml = R"({"accepts": {"application/xml": 5}})";
  EXPECT_EQ(verdict(xml, R"({"items": [{"type": "image/svg+xml"}]})"), Verdict::Match);
  EXPECT_EQ(verdict(xml, R"({"items": [{"type": "TEXT/XML"}]})"), Verdict::Match);
  EXPECT_EQ(verdict(xml, R"({"items": [{"type": "text/plain"}]})"), Verdict::NoMatch);
  EXPECT_EQ(verdict(R"({"only": ["text/plain"]})", R"({"items": [{"type": "text/x-csrc"}, {"type": "text/markdown"}]})"),
            Verdict::Match);
}

TEST(ActivationRule, CountOnlyAndCombinations) {
  const std::string_view offer = R"({"items": [{"type": "image/png", "count": 2}, {"type": "text/plain"}]})";
  EXPECT_EQ(verdict(R"({"count": {"type": "image/*", "min": 2, "max": 2}})", offer), Verdict::Match);
  EXPECT_EQ(verdict(R"({"count": {"type": "image/*", "min": 3}})", offer), Verdict::NoMatch);
  EXPECT_EQ(verdict(R"({"count": {"type": "audio/*"}})", offer), Verdict::NoMatch);  // min defaults to 1
  EXPECT_EQ(verdict(R"({"count": {"type": "audio/*", "min": 0, "max": 0}})", offer), Verdict::Match);
  EXPECT_EQ(verdict(R"({"count": {"max": 3}})", offer), Verdict::Match);  // every item
  EXPECT_EQ(verdict(R"({"count": {"max": 2}})", offer), Verdict::NoMatch);
  EXPECT_EQ(verdict(R"({"only": ["image/*"]})", offer), Verdict::NoMatch);
  EXPECT_EQ(verdict(R"({"only": ["image/*"]})", R"({"items": []})"), Verdict::Match);
  EXPECT_EQ(verdict(R"({"all": [{"only": ["image/*", "text/plain"]}, {"count": {"type": "text/plain", "max": 1}}]})", offer),
            Verdict::Match);
  EXPECT_EQ(verdict(R"({"any": [{"count": {"type": "audio/*"}}, {"not": {"count": {"type": "video/*"}}}]})", offer),
            Verdict::Match);
  EXPECT_EQ(verdict(R"({"all": []})", offer), Verdict::Match);
  EXPECT_EQ(verdict(R"({"any": []})", offer), Verdict::NoMatch);
}

TEST(ActivationRule, MalformedRulesMatchNothingNotEvenNegated) {
  const std::string_view offer = R"({"items": [{"type": "image/png"}]})";
  for (std::string_view rule : {
           R"("image/png")", R"({})", R"({"only": ["image/png"], "all": []})", R"({"matches": "image/png"})",
           R"({"not": {"unknown": 1}})", R"({"accepts": {"image/png": -1}})", R"({"accepts": {"image/png": "2"}})",
           R"({"accepts": {"not a type": 1}})", R"({"accepts": {}})", R"({"count": {"type": "image/png", "least": 1}})",
           R"({"count": {"max": 1.5}})", R"({"only": []})", R"({"only": [7]})", R"({"all": {"only": ["a/b"]}})"}) {
    const Evaluation evaluation = evaluate(json(rule), json(offer), systemTypes());
    EXPECT_EQ(evaluation.verdict, Verdict::Malformed) << rule;
    EXPECT_FALSE(evaluation.problem.empty()) << rule;
    EXPECT_EQ(ruleProblem(json(rule)), evaluation.problem) << rule;
  }
  EXPECT_EQ(ruleProblem(json(R"({"not": {"unknown": 1}})")), "rule.not: unknown condition \"unknown\"");
  EXPECT_EQ(ruleProblem(json(kImagesOrALink)), "");
}

TEST(ActivationRule, MalformedOffersMatchNothing) {
  for (std::string_view offer : {R"([])", R"({"items": {}})", R"({"items": [{"count": 1}]})",
                                 R"({"items": [{"type": "image/png", "count": 0}]})",
                                 R"({"items": [{"type": "image/*"}]})", R"({"items": [{"type": "image/png", "count": -2}]})",
                                 R"({"items": [{"type": "image/png", "count": 4294967296}]})", R"({"items": ["image/png"]})"}) {
    EXPECT_EQ(verdict(R"({"all": []})", offer), Verdict::Malformed) << offer;
  }
  // The host's own keys are its business.
  EXPECT_EQ(verdict(R"({"only": ["image/png"]})", R"({"items": [{"type": "image/png", "name": "a"}], "from": "x"})"),
            Verdict::Match);
}

TEST(ActivationRule, BoundsOnDepthSizeAndWork) {
  std::string deep = R"({"all": []})";
  for (int i = 0; i < kMaxRuleDepth; ++i) deep = R"({"not": )" + deep + "}";
  EXPECT_NE(ruleProblem(json(deep)).find("nest deeper than 8"), std::string::npos);

  std::string many = R"({"all": [)";
  for (size_t i = 0; i < kMaxRuleConditions; ++i) many += std::string(i ? "," : "") + R"({"all": []})";
  EXPECT_NE(ruleProblem(json(many + "]}")).find("more than 64 conditions"), std::string::npos);

  std::string offer = R"({"items": [)";
  for (size_t i = 0; i < kMaxOfferedEntries; ++i) offer += std::string(i ? "," : "") + R"({"type": "text/plain"})";
  EXPECT_EQ(verdict(R"({"all": []})", offer + R"(, {"type": "text/plain"}]})"), Verdict::Malformed);
  offer += "]}";

  // Each "only" asks 16 questions of each of 64 items before it holds:
  // five of them exceed the budget, and the evaluation is refused.
  std::string only = R"({"only": [)";
  for (int i = 0; i < 15; ++i) only += fmt::format(R"("image/x-{}", )", i);
  only += R"("text/plain"]})";
  std::string costly = R"({"all": [)";
  for (int i = 0; i < 5; ++i) costly += std::string(i ? "," : "") + only;
  const Evaluation evaluation = evaluate(json(costly + "]}"), json(offer), systemTypes());
  EXPECT_EQ(evaluation.verdict, Verdict::Malformed);
  EXPECT_EQ(evaluation.problem, "rule: needs more than 4096 type checks");
  EXPECT_EQ(verdict(only, offer), Verdict::Match);
}

}  // namespace
}  // namespace activation
