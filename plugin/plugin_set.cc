#include "plugin/plugin_set.h"

#include <algorithm>
#include <utility>

#include "plugin/plugin_keys.h"

namespace dr {
namespace {

bool IsDigit(char c) { return c >= '0' && c <= '9'; }

// The texts an equality test can meet in `v`: a string, or an array's string
// elements (others match nothing); none for another type.
std::optional<std::vector<std::string_view>> TextsOf(const Value& v) {
  if (std::optional<std::string_view> s = v.string()) return std::vector<std::string_view>{*s};
  if (!v.isArray()) return std::nullopt;
  std::vector<std::string_view> texts;
  for (const Value& element : v.array())
    if (std::optional<std::string_view> e = element.string()) texts.push_back(*e);
  return texts;
}

// Whether evaluating `pattern` may do more than compare: a "?" operator asks
// the type service (and an unknown one is logged), a dictionary is an
// activation rule. Rules holding one are evaluated against every record.
bool MayHaveEffects(const Value& pattern) {
  auto marked = [](const Value& v) {
    std::optional<std::string_view> s = v.string();
    return s && !s->empty() && s->front() == kTypeOperatorMark;
  };
  if (pattern.isDictionary() || marked(pattern)) return true;
  for (const Value& element : pattern.array())
    if (marked(element)) return true;
  return false;
}

// The equality keys of the texts a record's value must equal to satisfy
// `pattern`, or none when the pattern is anything but equality tests: a
// string or an array of them (elements that are not strings match nothing),
// each without an operator or with "=". Any other operator, any text without
// an equality key, or another type of pattern gives none.
std::optional<std::vector<std::string>> EqualityOperands(const Value& pattern) {
  std::optional<std::vector<std::string_view>> texts = TextsOf(pattern);
  if (!texts) return std::nullopt;
  std::vector<std::string> keys;
  for (std::string_view text : *texts) {
    if (!text.empty() && (text.front() == '<' || text.front() == '>')) return std::nullopt;
    if (!text.empty() && text.front() == '=') text.remove_prefix(1);
    std::optional<std::string> key = VersionEqualityKey(text);
    if (!key) return std::nullopt;
    keys.push_back(std::move(*key));
  }
  return keys;
}

void Append(std::vector<uint32_t>& positions, uint32_t position) {
  if (positions.empty() || positions.back() != position) positions.push_back(position);
}

}  // namespace

std::optional<std::string> VersionEqualityKey(std::string_view text) {
  std::string key;
  key.reserve(text.size());
  for (size_t i = 0; i < text.size();) {
    if (static_cast<unsigned char>(text[i]) >= 0x80) return std::nullopt;
    if (!IsDigit(text[i])) {
      key.push_back(text[i++]);
      continue;
    }
    size_t end = i;
    while (end < text.size() && IsDigit(text[end])) ++end;
    while (i + 1 < end && text[i] == '0') ++i;  // a run of zeros stays one "0"
    key.append(text.substr(i, end - i));
    i = end;
  }
  return key;
}

PlugInSet::PlugInSet(std::vector<DRDPlugInPtr> records) : records_(std::move(records)) {
  for (uint32_t i = 0; i < records_.size(); ++i) {
    const DRDPlugIn* r = records_[i].get();
    if (r && !r->onSystemVolume() && !r->containingUrl() &&
        Is17732150Path(r->path().value_or(""))) {
      internalFilters_.push_back(i);
    }
  }
}

PlugInSet::KeyIndex PlugInSet::buildIndex(std::string_view key) const {
  KeyIndex index;
  std::vector<std::string> keys;
  for (uint32_t i = 0; i < records_.size(); ++i) {
    if (!records_[i]) continue;  // examining no record does nothing
    const Value value = records_[i]->ruleValue(key);
    // Only strings and arrays can satisfy an equality pattern, an array
    // through any of its string elements.
    keys.clear();
    bool keyed = true;
    for (std::string_view text : TextsOf(value).value_or(std::vector<std::string_view>{})) {
      std::optional<std::string> k = VersionEqualityKey(text);
      if (k) keys.push_back(std::move(*k));
      keyed = keyed && k.has_value();
    }
    if (!keyed) {
      index.unkeyed.push_back(i);
      continue;
    }
    for (const std::string& k : keys) Append(index.byValue[k], i);
  }
  return index;
}

const PlugInSet::KeyIndex* PlugInSet::indexFor(std::string_view key) const {
  std::lock_guard<std::mutex> lock(mu_);
  if (auto it = indexes_.find(key); it != indexes_.end()) return it->second.get();
  if (indexes_.size() >= kMaxIndexedKeys) return nullptr;
  auto index = std::make_unique<KeyIndex>(buildIndex(key));
  const KeyIndex* built = index.get();
  indexes_.emplace(std::string(key), std::move(index));
  return built;
}

std::optional<std::vector<uint32_t>> PlugInSet::mayMatch(const Value& rules) const {
  if (!rules.isDictionary()) return std::nullopt;
  for (const auto& [key, pattern] : rules.dictionary())
    if (MayHaveEffects(pattern)) return std::nullopt;
  // Every rule must hold, so any one rule's candidates will do: the fewest.
  std::optional<std::vector<uint32_t>> best;
  for (const auto& [key, pattern] : rules.dictionary()) {
    std::optional<std::vector<std::string>> operands = EqualityOperands(pattern);
    if (!operands) continue;
    const KeyIndex* index = indexFor(key);
    if (!index) continue;
    std::vector<uint32_t> positions = index->unkeyed;
    for (const std::string& operand : *operands) {
      auto found = index->byValue.find(operand);
      if (found != index->byValue.end()) {
        positions.insert(positions.end(), found->second.begin(), found->second.end());
      }
    }
    std::sort(positions.begin(), positions.end());
    positions.erase(std::unique(positions.begin(), positions.end()), positions.end());
    if (!best || positions.size() < best->size()) best = std::move(positions);
  }
  return best;
}

}  // namespace dr
