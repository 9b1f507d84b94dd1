// Small stateless helpers shared by the plug-in model and the daemon:
// copy-and-change of a dictionary, and version-string comparison.
// The error builders DRMakeError and DRMakeErrorWithFormat live in
// core/format.h. Safe to call from any thread.
#pragma once

#include <string_view>

#include "core/format.h"
#include "core/value.h"

namespace dr {

// A new dictionary: a copy of `dictionary` in which `key` maps to `value`, or
// from which `key` is removed when `value` is absent. `dictionary` itself is
// never changed. An absent (or non-dictionary) receiver yields absent.
// The plug-in layer's name for Value::changing, which does the work (core
// and the client library, below this layer, call that directly); the
// plug-in layer copies-and-changes dictionaries through this name only.
Value dictionaryChangingTo(const Value& dictionary, std::string_view key, const Value& value);

// Orders two version strings: -1 when `a` comes before `b`, 0 when they are
// the same, +1 when after. Runs of decimal digits compare by numeric value
// (so 1.10 is after 1.9, and 01 equals 1); other characters compare by code
// point, case-sensitively (A before a), after canonical decomposition, so
// canonically equivalent sequences are equal; a digit of any script meeting
// another character orders as an ASCII digit would; when one string is a
// proper prefix of the other, the shorter comes first. Bytes that are not
// UTF-8 read as U+FFFD. The order is total: antisymmetric and transitive.
int compareVersionString(std::string_view a, std::string_view b);

}  // namespace dr
