// TNDPlugIn's matching of rules dictionaries: key resolution, patterns,
// comparison operators, the election value and activation rules.

#include <cmath>
#include <limits>

#include "libtenon/model/PlugInKeys.h"
#include "libtenon/model/VersionComparison.h"
#include "platform/activation/ActivationRule.h"
#include "platform/log/Log.h"
#include "tenond/plugin/TNDPlugIn.h"

namespace tnd {
namespace {

constexpr std::string_view kEntitlementPrefix = "ENTITLEMENT:";
constexpr std::string_view kUUIDKey = "com.ostrel.uuid";
constexpr std::string_view kElectionKey = "XTUserElection";
constexpr std::string_view kContainingAppKey = "XTExtensionContainingApp";
constexpr std::string_view kConformsOperator = "?TY-CONFORMS:";
constexpr std::string_view kIsOperator = "?TY-IS:";
constexpr int64_t kElectionMask = ~int64_t{0xFF00};
constexpr size_t kTypeCheckCost = 16;
constexpr size_t kEntryCost = 4;

// Equality with true and false is equality of numbers: 1 and 0 count.
bool isTrue(const tn::Value& value) { return value == tn::Value(true); }
bool isFalse(const tn::Value& value) { return value == tn::Value(false); }

// A number as a signed 64-bit integer (unsigned ones wrap, doubles are
// truncated when they fit); none for other kinds.
std::optional<int64_t> signed64(const tn::Value& number) {
  if (auto b = number.boolean()) return *b ? 1 : 0;
  if (auto i = number.int64()) return *i;
  if (auto u = number.uint64()) return static_cast<int64_t>(*u);
  if (auto d = number.real()) {
    if (std::isfinite(*d) && *d > -9.2e18 && *d < 9.2e18) return static_cast<int64_t>(*d);
  }
  return std::nullopt;
}

// One public call's evaluation: the context, and the work it may still do.
class Matcher {
 public:
  explicit Matcher(const TNDMatchContext& context) : context_(context) {}

  bool exhausted() const { return spent_ > TNDPlugIn::kMaxMatchWork; }

  bool key(const TNDPlugIn& plugIn, std::string_view key, const tn::Value& pattern) {
    if (!spend(kEntryCost)) return false;
    bool refused = false;
    const tn::Value value = resolve(plugIn, key, refused);
    if (refused) return false;
    if (isTrue(pattern)) return !value.isNull() && !isFalse(value);
    if (isFalse(pattern)) return value.isNull() || isFalse(value);
    if (value.isNull()) return false;
    if (pattern.isDictionary()) return dictionary(value, pattern);
    if (const std::string* text = value.string()) return patterns(*text, pattern);
    const tn::Array* elements = value.array();
    if (!elements || elements->size() > TNDPlugIn::kMaxMatchAlternatives) return false;
    for (const tn::Value& element : *elements) {
      const std::string* text = element.string();
      if (text && patterns(*text, pattern)) return true;
    }
    return false;
  }

  bool dictionary(const tn::Value& value, const tn::Value& pattern) {
    TN_LOG_DEBUG(tn::log::extension(), "evaluating XTExtension filter: {} value: {}", pattern, value);
    if (exhausted()) return false;
    const activation::Evaluation evaluation = activation::evaluate(value, pattern, *context_.types);
    return spend(evaluation.typeChecks * kTypeCheckCost) && evaluation.verdict == activation::Verdict::Match;
  }

  bool patterns(std::string_view value, const tn::Value& pattern) {
    if (const std::string* text = pattern.string()) return comparison(value, *text);
    const tn::Array* alternatives = pattern.array();
    if (!alternatives || alternatives->size() > TNDPlugIn::kMaxMatchAlternatives) return false;
    for (const tn::Value& alternative : *alternatives) {
      const std::string* text = alternative.string();
      if (text && comparison(value, *text)) return true;
    }
    return false;
  }

  bool comparison(std::string_view value, std::string_view pattern) {
    if (!spend(1 + value.size() + pattern.size())) return false;
    if (pattern.starts_with(kConformsOperator)) {
      return spend(kTypeCheckCost) && context_.types->conforms(value, pattern.substr(kConformsOperator.size()));
    }
    if (pattern.starts_with(kIsOperator)) {
      return spend(kTypeCheckCost) && context_.types->conforms(pattern.substr(kIsOperator.size()), value);
    }
    if (pattern.starts_with('?')) {
      TN_LOG_INFO(tn::log::ops(), "unrecognized match operator:{}", pattern);
      return false;
    }
    if (pattern.starts_with("<>")) return tn::compareVersionString(value, pattern.substr(2)) != 0;
    if (pattern.starts_with("<=")) return tn::compareVersionString(value, pattern.substr(2)) <= 0;
    if (pattern.starts_with(">=")) return tn::compareVersionString(value, pattern.substr(2)) >= 0;
    if (pattern.starts_with('=')) return tn::compareVersionString(value, pattern.substr(1)) == 0;
    if (pattern.starts_with('<')) return tn::compareVersionString(value, pattern.substr(1)) < 0;
    if (pattern.starts_with('>')) return tn::compareVersionString(value, pattern.substr(1)) > 0;
    return tn::compareVersionString(value, pattern) == 0;
  }

 private:
  bool spend(size_t units) {
    spent_ += units;
    return !exhausted();
  }

  // The value a key selects; `refused` for a containing-application key of
  // a plug-in outside any application.
  tn::Value resolve(const TNDPlugIn& plugIn, std::string_view key, bool& refused) const {
    if (key.starts_with(kEntitlementPrefix)) return plugIn.valueForEntitlement(key.substr(kEntitlementPrefix.size()));
    if (key == tn::keys::kIdentifier) {
      if (std::optional<std::string> identifier = plugIn.identifier()) return tn::Value(*identifier);
    } else if (key == kUUIDKey) {
      if (std::optional<tn::UUID> uuid = plugIn.uuid()) return tn::Value(uuid->string());
    } else if (key == kElectionKey) {
      return tn::Value(plugIn.electionValue(context_));
    } else if (key == kContainingAppKey) {
      std::optional<std::string> path = plugIn.containingPath();
      refused = !path;
      return path ? tn::Value(*path) : tn::Value();
    }
    // One read of the information dictionary serves both places.
    const tn::Value info = plugIn.bundleInfoDictionary();
    const tn::Value& attribute = info[tn::keys::kXTExtension][tn::keys::kAttributes][key];
    return attribute.isNull() ? info[key] : attribute;
  }

  const TNDMatchContext& context_;
  size_t spent_ = 0;
};

}  // namespace

bool TNDPlugIn::match(const tn::Value& rules) const { return match(rules, TNDMatchContext::current()); }

bool TNDPlugIn::match(const tn::Value& rules, const TNDMatchContext& context) const {
  if (rules.isNull()) return true;
  const tn::Dictionary* entries = rules.dictionary();
  if (!entries || entries->size() > kMaxRuleEntries) return false;
  Matcher matcher(context);
  for (const auto& [key, pattern] : *entries) {
    if (!matcher.key(*this, key, pattern)) {
      if (matcher.exhausted()) {
        TN_LOG_INFO(tn::log::ops(), "rules too costly to match against plug-in {}; no match",
                    uuid() ? uuid()->string() : std::string("(none)"));
      }
      return false;
    }
  }
  return true;
}

bool TNDPlugIn::matchKey(std::string_view key, const tn::Value& pattern, const TNDMatchContext& context) const {
  return Matcher(context).key(*this, key, pattern);
}

bool TNDPlugIn::matchDictionary(const tn::Value& value, const tn::Value& pattern, const TNDMatchContext& context) {
  return Matcher(context).dictionary(value, pattern);
}

bool TNDPlugIn::matchValue(std::string_view value, const tn::Value& patterns, const TNDMatchContext& context) {
  return Matcher(context).patterns(value, patterns);
}

bool TNDPlugIn::matchValue(std::string_view value, std::string_view pattern, const TNDMatchContext& context) {
  return Matcher(context).comparison(value, pattern);
}

std::string TNDPlugIn::electionValue(const TNDMatchContext& context) const {
  int64_t election = 0;
  if (context.annotationForPlugIn) {
    if (std::optional<tn::Dictionary> annotation = context.annotationForPlugIn(*this)) {
      election = signed64(annotation->get("election")).value_or(0);
    }
  }
  return std::to_string(election & kElectionMask);
}

}  // namespace tnd
