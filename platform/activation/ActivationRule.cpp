#include "platform/activation/ActivationRule.h"

#include <algorithm>
#include <limits>
#include <optional>
#include <string_view>
#include <vector>

#include <fmt/format.h>

#include "platform/types/TypeName.h"

namespace activation {
namespace {

constexpr uint64_t kMaxItemCount = std::numeric_limits<uint32_t>::max();

struct Item {
  std::string_view type;
  uint64_t count;
};

// The offer's items, or a problem.
std::optional<std::vector<Item>> readOffer(const tn::Value& offer, std::string& problem) {
  const tn::Array* list = offer["items"].array();
  if (!list || list->size() > kMaxOfferedEntries) {
    problem = fmt::format("offer: \"items\" is not a list of at most {} items", kMaxOfferedEntries);
    return std::nullopt;
  }
  std::vector<Item> items;
  for (size_t i = 0; i < list->size(); ++i) {
    const tn::Value& entry = (*list)[i];
    const std::string* type = entry["type"].string();
    const tn::Value& count = entry["count"];
    const std::optional<uint64_t> number = count.isNull() ? std::optional<uint64_t>(1) : count.uint64();
    if (!type || !types::isTypeName(*type) || !number || *number == 0 || *number > kMaxItemCount) {
      problem = fmt::format("offer: items[{}] needs a type name and a count from 1", i);
      return std::nullopt;
    }
    items.push_back(Item{*type, *number});
  }
  return items;
}

// Evaluates a rule that Validator accepted. Each conformance question
// counts against kMaxTypeChecks; once that is spent every answer is no and
// exhausted() tells the caller to call the whole evaluation malformed.
class Evaluator {
 public:
  Evaluator(const std::vector<Item>& items, const types::TypeTable& table) : items_(items), types_(table) {}

  bool exhausted() const { return checks_ > kMaxTypeChecks; }
  size_t checks() const { return checks_; }

  bool holds(const tn::Value& rule) {
    const auto& [op, operand] = rule.dictionary()->entries().front();
    if (op == "accepts") return accepts(*operand.dictionary());
    if (op == "count") return count(operand);
    if (op == "only") return only(*operand.array());
    if (op == "not") return !holds(operand) && !exhausted();
    const tn::Array& list = *operand.array();
    if (op == "all") return std::all_of(list.begin(), list.end(), [&](const tn::Value& c) { return holds(c); });
    return std::any_of(list.begin(), list.end(), [&](const tn::Value& c) { return holds(c); });
  }

 private:
  bool conforms(std::string_view type, std::string_view to) {
    if (++checks_ > kMaxTypeChecks) return false;
    return types_.conforms(type, to);
  }

  uint64_t itemsConformingTo(std::string_view type) {
    uint64_t total = 0;
    for (const Item& item : items_) {
      if (conforms(item.type, type)) total += item.count;
    }
    return total;
  }

  bool accepts(const tn::Dictionary& limits) {
    if (items_.empty()) return false;
    for (const Item& item : items_) {
      const bool accepted = std::any_of(limits.begin(), limits.end(),
                                        [&](const tn::Dictionary::Entry& limit) { return conforms(item.type, limit.first); });
      if (!accepted) return false;
    }
    for (const auto& [type, limit] : limits) {
      if (itemsConformingTo(type) > *limit.uint64()) return false;
    }
    return true;
  }

  bool count(const tn::Value& fields) {
    uint64_t total = 0;
    if (const std::string* type = fields["type"].string()) {
      total = itemsConformingTo(*type);
    } else {
      for (const Item& item : items_) total += item.count;
    }
    const uint64_t least = fields["min"].uint64().value_or(1);
    const uint64_t most = fields["max"].uint64().value_or(std::numeric_limits<uint64_t>::max());
    return total >= least && total <= most;
  }

  bool only(const tn::Array& allowed) {
    return std::all_of(items_.begin(), items_.end(), [&](const Item& item) {
      return std::any_of(allowed.begin(), allowed.end(),
                         [&](const tn::Value& type) { return conforms(item.type, *type.string()); });
    });
  }

  const std::vector<Item>& items_;
  const types::TypeTable& types_;
  size_t checks_ = 0;
};

}  // namespace

Evaluation evaluate(const tn::Value& rule, const tn::Value& offer, const types::TypeTable& types) {
  Evaluation result;
  result.problem = ruleProblem(rule);
  if (!result.problem.empty()) return result;
  const std::optional<std::vector<Item>> items = readOffer(offer, result.problem);
  if (!items) return result;
  Evaluator evaluator(*items, types);
  const bool holds = evaluator.holds(rule);
  result.typeChecks = evaluator.checks();
  if (evaluator.exhausted()) {
    result.problem = fmt::format("rule: needs more than {} type checks", kMaxTypeChecks);
    return result;
  }
  result.verdict = holds ? Verdict::Match : Verdict::NoMatch;
  return result;
}

bool matches(const tn::Value& rule, const tn::Value& offer, const types::TypeTable& types) {
  return evaluate(rule, offer, types).verdict == Verdict::Match;
}

}  // namespace activation
