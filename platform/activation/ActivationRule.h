#pragma once

// platform/activation: activation rules (library tn_activation).
//
// A plug-in's activation rule says which items it accepts; a host's offer
// says which items it has. Both are plain structured values, so nothing of
// the plug-in is run to decide: evaluate() walks the two values and the
// type hierarchy, with bounded work, and answers. docs/activation-rules.md
// describes the format for authors, with examples.
//
// Offer (the host's):
//   {"items": [{"type": "image/png", "count": 3}, {"type": "text/uri-list"}]}
// "count" is 1 when absent; other keys of an item are the host's own and
// are ignored.
//
// Rule (the plug-in's), one condition, a dictionary with exactly one of:
//   {"accepts": {"image/*": 10, "text/uri-list": 1}}
//        every item conforms to one of the types, at least one item is
//        offered, and the items conforming to each type are at most its
//        number;
//   {"count": {"type": T, "min": a, "max": b}}
//        the items conforming to T (every item, without "type") number at
//        least a (default 1) and at most b (default unlimited);
//   {"only": [T, ...]}      every item conforms to one of the types;
//   {"all": [rule, ...]}    every rule holds (none: holds);
//   {"any": [rule, ...]}    at least one rule holds (none: never);
//   {"not": rule}           the rule does not hold.
//
// Anything else, in the rule or the offer, is malformed, and a malformed
// rule or offer matches nothing (not even under "not"). Bounds, also
// malformed when exceeded: kMaxRuleDepth, kMaxRuleConditions,
// kMaxTypesPerCondition, kMaxOfferedEntries, and kMaxTypeChecks
// conformance questions for one evaluation.
//
// Pure functions: no side effects, any thread.

#include <cstddef>
#include <string>

#include "platform/types/TypeTable.h"
#include "platform/value/Value.h"

namespace activation {

inline constexpr int kMaxRuleDepth = 8;
inline constexpr size_t kMaxRuleConditions = 64;
inline constexpr size_t kMaxTypesPerCondition = 16;
inline constexpr size_t kMaxOfferedEntries = 64;
inline constexpr size_t kMaxTypeChecks = 4096;

enum class Verdict { Match, NoMatch, Malformed };

struct Evaluation {
  Verdict verdict = Verdict::Malformed;
  std::string problem;  // what is malformed, when verdict is Malformed
  size_t typeChecks = 0;  // conformance questions asked (the evaluation's cost)
};

// The rule against the offer, types from `types`.
Evaluation evaluate(const tn::Value& rule, const tn::Value& offer, const types::TypeTable& types);

// evaluate(...).verdict == Verdict::Match.
bool matches(const tn::Value& rule, const tn::Value& offer, const types::TypeTable& types);

// What is malformed in rule alone, or empty when it is well-formed; for
// tools that check a plug-in before it is installed.
std::string ruleProblem(const tn::Value& rule);

}  // namespace activation
