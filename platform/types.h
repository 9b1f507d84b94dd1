// TypeService: which type identifiers conform to which, and whether a
// plug-in's activation rule accepts the items a host offers.
// Type identifiers are media types ("image/jpeg", told by their "/", compared
// without regard to ASCII case since media types are case-insensitive) or
// reverse-domain names a bundle declares ("org.example.photo", compared
// exactly). Answers are yes or no, never errors: unreadable data counts as
// absent. Every member is safe to call from any thread.
#pragma once

#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "core/value.h"

namespace dr {

class TypeService {
 public:
  virtual ~TypeService() = default;

  // Whether `type` conforms to `to`, transitively: it is `to`; the
  // shared-mime-info data makes it a subclass (an alias stands for its
  // canonical type); a text/* type conforms to text/plain; every type but an
  // inode/* one conforms to application/octet-stream; "MAJOR/*" takes every
  // media type of that major part; a registered bundle's "TypeDeclarations"
  // say so. An empty identifier conforms to nothing.
  virtual bool conformsTo(std::string_view type, std::string_view to) = 0;

  // Whether the activation `rule` a plug-in declares accepts the host's
  // `pattern` (type identifier → item count); see EvaluateActivationRule.
  virtual bool evaluateActivationRule(const Value& rule, const Value& pattern) = 0;
};

// The activation-rule evaluator over any conformance test:
// - rule boolean true: accepts every well-formed pattern;
// - rule dictionary (type → maximum count): accepts a pattern dictionary when
//   each type offered with a count above 0 conforms to some key of the rule
//   whose maximum is at least that count (so an empty pattern is accepted);
// - any other rule accepts nothing, and no rule accepts a pattern that is not
//   a dictionary of counts of 0 or more.
// See activation_rule.cc for how odd values read.
bool EvaluateActivationRule(
    const Value& rule, const Value& pattern,
    const std::function<bool(std::string_view, std::string_view)>& conforms);

}  // namespace dr
