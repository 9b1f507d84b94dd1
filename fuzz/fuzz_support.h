// Helpers shared by the fuzz targets: a strict comparison of values (for
// round-trip checks, where Value's own numeric equality is too forgiving), a
// log that drops every line (so the fuzzer's output stays readable and fast),
// and the one way a target reports a broken property.
#pragma once

#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <string_view>

#include "core/log.h"
#include "core/value.h"

namespace dr::fuzz {

// Equal types and contents; doubles and dates bit for bit, except that any
// two NaNs of the same sign are the same (parsers make their own payload).
inline bool SameDouble(double a, double b) {
  if (std::isnan(a) || std::isnan(b)) {
    return std::isnan(a) && std::isnan(b) && std::signbit(a) == std::signbit(b);
  }
  return std::memcmp(&a, &b, sizeof a) == 0;
}

inline bool SameValue(const Value& a, const Value& b) {
  if (a.type() != b.type()) return false;
  switch (a.type()) {
    case Value::Type::kAbsent:
      return true;
    case Value::Type::kBool:
      return a.boolValue() == b.boolValue();
    case Value::Type::kInt:
      return a.intValue() == b.intValue();
    case Value::Type::kUInt:
      return a.uintValue() == b.uintValue();
    case Value::Type::kDouble:
      return SameDouble(a.doubleValue(), b.doubleValue());
    case Value::Type::kDate:
      return SameDouble(a.date()->seconds, b.date()->seconds);
    case Value::Type::kString:
      return a.stringValue() == b.stringValue();
    case Value::Type::kData:
      return a.dataValue() == b.dataValue();
    case Value::Type::kUuid:
      return a.uuid() == b.uuid();
    case Value::Type::kArray: {
      const Array &x = a.array(), &y = b.array();
      if (x.size() != y.size()) return false;
      for (size_t i = 0; i < x.size(); ++i)
        if (!SameValue(x[i], y[i])) return false;
      return true;
    }
    case Value::Type::kDictionary: {
      const Dictionary &x = a.dictionary(), &y = b.dictionary();
      if (x.size() != y.size()) return false;
      for (auto i = x.begin(), j = y.begin(); i != x.end(); ++i, ++j)
        if (i->first != j->first || !SameValue(i->second, j->second)) return false;
      return true;
    }
  }
  return false;
}

// Drops every system-log line, unless DRD_FUZZ_LOG is set (to see why an
// input is refused); called once from LLVMFuzzerInitialize.
inline void SilenceLog() {
  if (std::getenv("DRD_FUZZ_LOG") == nullptr) SetLogSink([](std::string_view) {});
}

// A broken property is a finding: say which, and stop so that libFuzzer
// saves the input.
[[noreturn]] inline void Broken(const std::string& what) {
  std::fprintf(stderr, "fuzz: property broken: %s\n", what.c_str());
  std::abort();
}

#define DRD_FUZZ_CHECK(condition, what)         \
  do {                                          \
    if (!(condition)) ::dr::fuzz::Broken(what); \
  } while (0)

}  // namespace dr::fuzz
