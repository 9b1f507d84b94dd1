// PlugInSet: the records of every installed plug-in, in the order discovery
// examines them, with indexes that tell which records a host's rules can
// match at all.
//
// Discovery evaluates the host's rules against every installed plug-in; with
// thousands installed, that evaluation is most of a request's work although
// a host nearly always asks for one extension point. A rule whose patterns
// are all plain equality tests ("name" or "=name") can only be satisfied by a
// record whose value for the key compares equal to one of them, so an index
// from the key's values to record positions narrows the records to evaluate.
// The narrowing is only a prefilter: the chosen records are evaluated in
// full, and every record it leaves out is one whose evaluation would have
// failed without any effect (no log line).
//
// Immutable after construction except for the indexes, which are built on
// first use per rule key (under a mutex) and then only read; safe to share
// between threads. Records must be read-only, as the daemon's records are
// once built.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "core/value.h"
#include "plugin/plugin.h"

namespace dr {

// Older hosts still find the internal filters that ship outside any
// application under this folder.
inline constexpr std::string_view k17732150Path = "Effecta/InternalFilters.app";
inline bool Is17732150Path(std::string_view path) {
  return path.find(k17732150Path) != std::string_view::npos;
}

// A key under which two ASCII strings are equal exactly when
// compareVersionString orders them the same: each run of digits stands for
// its value (leading zeros dropped). None for text that is not ASCII, whose
// comparison decomposes characters and reads digits of every script.
std::optional<std::string> VersionEqualityKey(std::string_view text);

class PlugInSet {
 public:
  explicit PlugInSet(std::vector<DRDPlugInPtr> records);

  const std::vector<DRDPlugInPtr>& records() const { return records_; }
  size_t size() const { return records_.size(); }

  // Ascending positions of the records that may satisfy `rules`: every record
  // for which DRDPlugIn::match(rules) holds is among them, and evaluating
  // `rules` against any record left out fails and has no effect. None when
  // no rule narrows the set (every record must be evaluated): absent or
  // malformed rules, no rule made of equality patterns only, or any pattern
  // whose evaluation may log or consult the type service ("?" operators,
  // dictionaries).
  std::optional<std::vector<uint32_t>> mayMatch(const Value& rules) const;

  // Ascending positions of the records off the system volume and outside any
  // application whose path contains k17732150Path: the candidates whose
  // visibility check may have an effect for hosts that need the matching
  // workaround.
  const std::vector<uint32_t>& internalFilters() const { return internalFilters_; }

  // How many rule keys get an index; rules on further keys are evaluated
  // against every record, so hosts sending many keys cost memory no longer.
  static constexpr size_t kMaxIndexedKeys = 16;

 private:
  struct KeyIndex {
    // Equality key of a string value (or of an array value's string
    // element) -> ascending positions of the records having it.
    std::unordered_map<std::string, std::vector<uint32_t>> byValue;
    // Ascending positions of the records with a value that has no equality
    // key: always evaluated.
    std::vector<uint32_t> unkeyed;
  };

  // The index of `key`, built on first use; null once kMaxIndexedKeys other
  // keys have one.
  const KeyIndex* indexFor(std::string_view key) const;
  KeyIndex buildIndex(std::string_view key) const;

  const std::vector<DRDPlugInPtr> records_;
  std::vector<uint32_t> internalFilters_;
  mutable std::mutex mu_;
  mutable std::map<std::string, std::unique_ptr<KeyIndex>, std::less<>> indexes_;  // under mu_
};

}  // namespace dr
