// The activation-rule evaluator. How values of the wrong kind read (a rule or
// pattern comes from a bundle's or a host's own files, so any shape occurs):
// - Booleans are numbers (true is 1, false is 0), as everywhere in drd, so a
//   count or maximum of true means 1. A rule that is the number 1 is not the
//   boolean true, though: only a real boolean says "accept everything", so
//   that a stray number never opens a plug-in to every host.
// - A count the host offers must be a number that is 0 or more. A count that
//   is negative, not a number (NaN) or of another kind makes the whole
//   pattern unreadable, and an unreadable pattern is accepted by no rule, not
//   even true: ignoring the odd entry would accept items nobody looked at.
// - A maximum that is not a number (or is NaN) lets its key accept nothing;
//   the rule's other keys still count.
#include <compare>

#include "platform/types.h"

namespace dr {
namespace {

enum class Count { kUnreadable, kNone, kSome };

Count ReadCount(const Value& count) {
  if (!count.isNumber()) return Count::kUnreadable;
  std::optional<std::partial_ordering> sign = count.compareNumber(Value(0));
  if (!sign || *sign == std::partial_ordering::less) return Count::kUnreadable;
  return *sign == std::partial_ordering::equivalent ? Count::kNone : Count::kSome;
}

// Whether `maximum` allows `count` items; false for a maximum that is not a
// number.
bool Allows(const Value& maximum, const Value& count) {
  if (!maximum.isNumber()) return false;
  std::optional<std::partial_ordering> order = maximum.compareNumber(count);
  return order && *order != std::partial_ordering::less;
}

}  // namespace

bool EvaluateActivationRule(
    const Value& rule, const Value& pattern,
    const std::function<bool(std::string_view, std::string_view)>& conforms) {
  if (!pattern.isDictionary()) return false;
  for (const auto& [type, count] : pattern.dictionary()) {
    if (ReadCount(count) == Count::kUnreadable) return false;
  }
  if (rule.isBool()) return rule.boolValue();
  if (!rule.isDictionary()) return false;
  for (const auto& [type, count] : pattern.dictionary()) {
    if (ReadCount(count) == Count::kNone) continue;
    bool accepted = false;
    for (const auto& [ruleType, maximum] : rule.dictionary()) {
      if (Allows(maximum, count) && conforms(type, ruleType)) {
        accepted = true;
        break;
      }
    }
    if (!accepted) return false;
  }
  return true;
}

}  // namespace dr
