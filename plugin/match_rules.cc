// Match rules: a rules dictionary maps a key naming one of the plug-in's
// values to a pattern that value must satisfy. Evaluation is a pure read of
// the record; a rule of an unexpected shape simply does not match.
#include <string>
#include <string_view>

#include "core/log.h"
#include "platform/types.h"
#include "plugin/helpers.h"
#include "plugin/plugin.h"
#include "plugin/plugin_keys.h"

namespace dr {
namespace {

// A comparison operator: the ordering it expects and whether the test is
// negated. Tested in table order, so "<>" and "<=" are never read as "<".
struct ComparisonOperator {
  std::string_view prefix;
  int expected;  // compareVersionString's -1, 0 or +1
  bool negated;
};

constexpr ComparisonOperator kComparisonOperators[] = {
    {"<>", 0, true}, {"<=", 1, true},  {">=", -1, true},
    {"=", 0, false}, {"<", -1, false}, {">", 1, false},
};

bool IsTrue(const Value& v) { return v == Value(true); }
bool IsFalse(const Value& v) { return v == Value(false); }

}  // namespace

bool DRDPlugIn::match(const Value& rules) const {
  if (rules.isAbsent()) return true;
  // Rules that are not a dictionary constrain nothing we could check; they
  // match no plug-in rather than every one.
  if (!rules.isDictionary()) return false;
  for (const auto& [key, pattern] : rules.dictionary())
    if (!matchKeyPattern(key, pattern)) return false;
  return true;
}

const Value& DRDPlugIn::valueForRuleKey(std::string_view key, Value& holder) const {
  std::string_view prefix = kEntitlementRulePrefix;
  if (key.starts_with(prefix)) {
    holder = entitlements();
    return holder[key.substr(prefix.size())];
  }
  if (key == kUXExtensionIdentifierKey) {
    if (auto id = identifier()) return holder = Value(std::move(*id));
  } else if (key == kUuidRuleKey) {
    if (auto u = uuid()) return holder = Value(u->string());
  }
  holder = plugInDictionary();
  if (const Value& value = holder[kUXExtensionAttributesKey][key]; value.isPresent()) return value;
  holder = bundleInfoDictionary();
  return holder[key];
}

Value DRDPlugIn::ruleValue(std::string_view key) const {
  Value holder;
  return valueForRuleKey(key, holder);
}

bool DRDPlugIn::matchKeyPattern(std::string_view key, const Value& pattern) const {
  Value holder;
  const Value& value = valueForRuleKey(key, holder);
  if (IsTrue(pattern)) return value.isPresent() && !(value == Value(0));
  if (IsFalse(pattern)) return value.isAbsent() || value == Value(0);
  if (value.isAbsent()) return false;
  if (pattern.isDictionary()) return matchDictionaryPattern(value, pattern);
  if (value.isString()) return matchValuePatterns(value, pattern);
  if (value.isArray()) {
    for (const Value& element : value.array())
      if (matchValuePatterns(element, pattern)) return true;
    return false;
  }
  return false;
}

bool DRDPlugIn::matchValuePatterns(const Value& value, const Value& patterns) const {
  // An element of an array value that is not a string is never compared as
  // text: it matches no pattern, as a top-level value of that type would not.
  auto text = value.string();
  if (!text) return false;
  if (auto p = patterns.string()) return matchValuePattern(*text, *p);
  if (patterns.isArray()) {
    // Elements of a pattern array that are not strings are skipped.
    for (const Value& element : patterns.array())
      if (auto p = element.string(); p && matchValuePattern(*text, *p)) return true;
  }
  return false;
}

bool DRDPlugIn::matchValuePattern(std::string_view value, std::string_view pattern) const {
  if (!pattern.empty() && pattern.front() == kTypeOperatorMark) {
    std::string_view conforms = kConformsOperator;
    std::string_view is = kIsOperator;
    if (pattern.starts_with(conforms))
      return typeConformsTo(value, pattern.substr(conforms.size()));
    if (pattern.starts_with(is)) return typeConformsTo(pattern.substr(is.size()), value);
    SystemLog("unrecognized match operator:%@", pattern);
    return false;
  }
  ComparisonOperator op{"", 0, false};
  for (const ComparisonOperator& candidate : kComparisonOperators) {
    if (pattern.starts_with(candidate.prefix)) {
      op = candidate;
      break;
    }
  }
  std::string_view operand = pattern.substr(op.prefix.size());
  bool test = compareVersionString(value, operand) == op.expected;
  return test != op.negated;
}

}  // namespace dr

namespace dr {

bool DRDPlugIn::matchDictionaryPattern(const Value& value, const Value& pattern) const {
  if (services_.types != nullptr) return services_.types->evaluateActivationRule(value, pattern);
  return EvaluateActivationRule(value, pattern, [this](std::string_view a, std::string_view b) {
    return typeConformsTo(a, b);
  });
}

bool DRDPlugIn::typeConformsTo(std::string_view type, std::string_view to) const {
  if (services_.types != nullptr) return services_.types->conformsTo(type, to);
  return !type.empty() && type == to;
}

}  // namespace dr
