#include "platform/registrar/QueryNarrowing.h"

namespace registrar {
namespace {

bool isDigit(char c) { return c >= '0' && c <= '9'; }

bool isOperatorCharacter(char c) { return c == '?' || c == '<' || c == '>' || c == '='; }

// Keys whose value the registry does not resolve the daemon's way.
bool isDaemonOnlyKey(std::string_view key) {
  return key == "XTUserElection" || key == "com.ostrel.uuid" || key == "XTExtensionContainingApp" ||
         key.starts_with("ENTITLEMENT:");
}

// The patterns of an entry as equality operands, or none when one of them
// is not an equality.
std::optional<std::vector<std::string_view>> equalityOperands(const tn::Value& pattern) {
  std::vector<std::string_view> operands;
  if (pattern.isString()) {
    const std::optional<std::string_view> operand = equalityOperand(pattern);
    if (!operand) return std::nullopt;
    operands.push_back(*operand);
    return operands;
  }
  const tn::Array* elements = pattern.array();
  if (elements == nullptr) return std::nullopt;
  for (const tn::Value& element : *elements) {
    // A non-string element never matches in the daemon: it adds nothing.
    if (!element.isString()) continue;
    const std::optional<std::string_view> operand = equalityOperand(element);
    if (!operand) return std::nullopt;
    operands.push_back(*operand);
  }
  return operands;
}

bool isFalse(const tn::Value& value) { return value.isNumber() && value == tn::Value(false); }

bool stringMatchesAny(const std::string& value, const std::vector<std::string_view>& operands) {
  const std::string key = equalityKey(value);
  for (std::string_view operand : operands) {
    if (equalityKey(operand) == key) return true;
  }
  return false;
}

// The daemon's verdict for a value against equality operands: a string
// equal to one, or an array with a string element equal to one.
bool valueMatchesAny(const tn::Value& value, const std::vector<std::string_view>& operands) {
  if (const std::string* text = value.string()) return stringMatchesAny(*text, operands);
  if (const tn::Array* elements = value.array()) {
    for (const tn::Value& element : *elements) {
      if (const std::string* text = element.string(); text != nullptr && stringMatchesAny(*text, operands)) {
        return true;
      }
    }
  }
  return false;
}

const tn::Value& attributeOrInfo(const PlugInRecord& plugIn, std::string_view key) {
  const tn::Value& attributes = plugIn.plugInDictionary()[kExtensionAttributesKey];
  if (const tn::Dictionary* dictionary = attributes.dictionary()) {
    if (const tn::Value* found = dictionary->find(key)) return *found;
  }
  return plugIn.infoDictionary()[key];
}

bool entryMayMatch(std::string_view key, const tn::Value& pattern, const PlugInRecord& plugIn) {
  if (isDaemonOnlyKey(key)) return true;
  const bool identifierKey = key == kExtensionIdentifierKey;
  const tn::Value value = identifierKey ? tn::Value(plugIn.identifier()) : attributeOrInfo(plugIn, key);
  if (pattern.isNumber() && pattern == tn::Value(true)) return !value.isNull() && !isFalse(value);
  if (pattern.isNumber() && pattern == tn::Value(false)) return value.isNull() || isFalse(value);
  const std::optional<std::vector<std::string_view>> operands = equalityOperands(pattern);
  if (!operands) return true;
  return valueMatchesAny(value, *operands);
}

}  // namespace

std::string equalityKey(std::string_view text) {
  std::string key;
  key.reserve(text.size());
  for (size_t i = 0; i < text.size();) {
    if (!isDigit(text[i])) {
      key += text[i++];
      continue;
    }
    size_t end = i;
    while (end < text.size() && isDigit(text[end])) ++end;
    size_t first = i;
    while (first + 1 < end && text[first] == '0') ++first;
    key.append(text.substr(first, end - first));
    i = end;
  }
  return key;
}

std::optional<std::string_view> equalityOperand(const tn::Value& pattern) {
  const std::string* text = pattern.string();
  if (text == nullptr) return std::nullopt;
  std::string_view view = *text;
  if (view.empty() || !isOperatorCharacter(view.front())) return view;
  if (view.front() == '=') return view.substr(1);
  return std::nullopt;
}

bool mayMatch(const tn::Value& rules, const PlugInRecord& plugIn) {
  const tn::Dictionary* entries = rules.dictionary();
  if (entries == nullptr) return true;
  for (const auto& [key, pattern] : *entries) {
    if (!entryMayMatch(key, pattern, plugIn)) return false;
  }
  return true;
}

std::optional<std::vector<std::string>> identifierKeys(const tn::Value& rules) {
  const tn::Value& pattern = rules[kExtensionIdentifierKey];
  if (pattern.isNull()) return std::nullopt;
  const std::optional<std::vector<std::string_view>> operands = equalityOperands(pattern);
  if (!operands) return std::nullopt;
  std::vector<std::string> keys;
  for (std::string_view operand : *operands) keys.push_back(equalityKey(operand));
  return keys;
}

}  // namespace registrar
