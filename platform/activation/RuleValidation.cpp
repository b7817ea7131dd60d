// The structure of activation rules: what ruleProblem() and evaluate()
// refuse before anything is evaluated.

#include <fmt/format.h>

#include "platform/activation/ActivationRule.h"
#include "platform/types/TypeName.h"

namespace activation {
namespace {

bool isTypeOrRange(const tn::Value& value) {
  const std::string* name = value.string();
  return name && (types::isTypeName(*name) || types::isMediaRange(*name));
}

class Validator {
 public:
  // Empty when rule is well-formed.
  std::string check(const tn::Value& rule) {
    condition(rule, 1, "rule");
    return problem_;
  }

 private:
  bool fail(std::string_view where, std::string_view what) {
    if (problem_.empty()) problem_ = fmt::format("{}: {}", where, what);
    return false;
  }

  bool condition(const tn::Value& rule, int depth, const std::string& where) {
    if (depth > kMaxRuleDepth) return fail(where, fmt::format("conditions nest deeper than {}", kMaxRuleDepth));
    if (++conditions_ > kMaxRuleConditions) return fail(where, fmt::format("more than {} conditions", kMaxRuleConditions));
    const tn::Dictionary* dictionary = rule.dictionary();
    if (!dictionary || dictionary->size() != 1) return fail(where, "a condition is a dictionary with one key");
    const auto& [op, operand] = dictionary->entries().front();
    const std::string inner = where + "." + op;
    if (op == "accepts") return accepts(operand, inner);
    if (op == "count") return count(operand, inner);
    if (op == "only") return typeList(operand, inner);
    if (op == "not") return condition(operand, depth + 1, inner);
    if (op == "all" || op == "any") return conditionList(operand, depth, inner);
    return fail(where, fmt::format("unknown condition \"{}\"", op));
  }

  bool conditionList(const tn::Value& operand, int depth, const std::string& where) {
    const tn::Array* list = operand.array();
    if (!list) return fail(where, "not a list of conditions");
    for (size_t i = 0; i < list->size(); ++i) {
      if (!condition((*list)[i], depth + 1, fmt::format("{}[{}]", where, i))) return false;
    }
    return true;
  }

  bool typeList(const tn::Value& operand, const std::string& where) {
    const tn::Array* list = operand.array();
    if (!list || list->empty() || list->size() > kMaxTypesPerCondition) {
      return fail(where, fmt::format("not a list of 1 to {} types", kMaxTypesPerCondition));
    }
    for (const tn::Value& type : *list) {
      if (!isTypeOrRange(type)) return fail(where, "a list entry is not a type name");
    }
    return true;
  }

  bool accepts(const tn::Value& operand, const std::string& where) {
    const tn::Dictionary* limits = operand.dictionary();
    if (!limits || limits->empty() || limits->size() > kMaxTypesPerCondition) {
      return fail(where, fmt::format("not a dictionary of 1 to {} types", kMaxTypesPerCondition));
    }
    for (const auto& [type, limit] : *limits) {
      if (!isTypeOrRange(tn::Value(type))) return fail(where, fmt::format("\"{}\" is not a type name", type));
      if (!limit.uint64()) return fail(where + "." + type, "not a count (an integer from 0)");
    }
    return true;
  }

  bool count(const tn::Value& operand, const std::string& where) {
    const tn::Dictionary* fields = operand.dictionary();
    if (!fields) return fail(where, "not a dictionary");
    for (const auto& [key, value] : *fields) {
      if (key == "type") {
        if (!isTypeOrRange(value)) return fail(where + ".type", "not a type name");
      } else if (key == "min" || key == "max") {
        if (!value.uint64()) return fail(where + "." + key, "not a count (an integer from 0)");
      } else {
        return fail(where, fmt::format("unknown key \"{}\"", key));
      }
    }
    return true;
  }

  size_t conditions_ = 0;
  std::string problem_;
};

}  // namespace

std::string ruleProblem(const tn::Value& rule) { return Validator().check(rule); }

}  // namespace activation
