// Type conformance from a table (reflexive, transitive, exact); activation rules through the
// real evaluator. Records every conformance question.
#pragma once

#include <map>
#include <set>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "core/value.h"
#include "platform/types.h"

namespace dr::test {

class FakeTypeService : public TypeService {
 public:
  // type → the types it conforms to directly.
  std::map<std::string, std::vector<std::string>, std::less<>> parents;
  std::vector<std::pair<std::string, std::string>> questions;

  bool conformsTo(std::string_view type, std::string_view to) override {
    questions.emplace_back(type, to);
    if (type.empty() || to.empty()) return false;
    std::vector<std::string> pending{std::string(type)};
    std::set<std::string, std::less<>> seen{std::string(type)};
    while (!pending.empty()) {
      std::string t = std::move(pending.back());
      pending.pop_back();
      if (t == to) return true;
      auto it = parents.find(t);
      if (it == parents.end()) continue;
      for (const std::string& p : it->second) {
        if (seen.insert(p).second) pending.push_back(p);
      }
    }
    return false;
  }

  bool evaluateActivationRule(const Value& rule, const Value& pattern) override {
    return EvaluateActivationRule(
        rule, pattern, [this](std::string_view a, std::string_view b) { return conformsTo(a, b); });
  }
};

}  // namespace dr::test
