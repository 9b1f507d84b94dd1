// Discovery: which installed plug-ins one host is offered, and why each other
// one is not.
//
// The "match" request runs one Discovery per request: each candidate is
// examined in turn (visibility, rules, the user's exclusions, the host's
// right to use it, duplicates of one identifier), then the accepted forms
// are marked with replacement relations and the administrator's policy may
// veto any of them. `drkit explain` runs the very same steps against the
// registry on disk and prints the outcome of every candidate, so a plug-in
// author sees why a plug-in is left out.
//
// One Discovery serves one request on one thread; it holds no lock and keeps
// nothing after it is dropped. The discovery flags word is shared by all
// candidates of the request: a bit set while one candidate is examined stays
// set for the candidates examined after it.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "core/value.h"
#include "plugin/plugin.h"
#include "plugin/plugin_client.h"
#include "plugin/plugin_set.h"
#include "wire/drm1.h"
#include "wire/protocol.h"

namespace dr {

// Whether the host application `identifier` at short version `version` is
// one of the older hosts whose discovery requests need the 17732150
// workaround.
bool Needs17732150Workaround(std::string_view identifier, std::string_view version);

// The entitlement a host needs to use message::kDiscoverAll (and must not be
// sandboxed).
inline constexpr const char* kManagerEntitlement = "com.corvel.private.dromon.manager";

// What happened to one candidate. Every value but kReturned names the step
// that left the plug-in out.
enum class DiscoveryOutcome {
  kReturned,            // in the reply
  kHybrid,              // has embedded code and the host did not ask for hybrids
  kNotInApplication,    // outside the system volume and inside no application
  kSystemOnly,          // outside the system volume and the host asked for system only
  kDedicatedElsewhere,  // dedicated to another application
  kHeld,                // on hold
  kRulesMismatch,       // does not satisfy the host's rules
  kExcluded,            // matches one of the user's exclusions
  kNotAuthorized,       // the host may not use it (detail: the reason)
  kSuperseded,          // another copy of the same identifier won
  kVetoed,              // the administrator's policy denies it to the host
};

// A short lower-case phrase for `outcome`, for people ("returned", "held").
const char* DiscoveryOutcomeName(DiscoveryOutcome outcome);

// The host asking. `client` must outlive the Discovery.
struct DiscoveryHost {
  const PlugInClient* client = nullptr;
  // The folder of the host application's plug-ins; none for a host that lies
  // in no bundle (it sees no dedicated plug-in).
  std::optional<std::string> plugInsPath;
  // For log lines: the host's bundle identifier (may be empty).
  std::string bundleIdentifier;
  // Whether this is one of the older hosts that need the 17732150 matching
  // workaround.
  bool needs17732150Workaround = false;
};

// What Discovery asks of the daemon around it. Unset functions mean: no
// hold, no annotation, nothing vetoed, no log.
struct DiscoveryServices {
  std::function<bool(const DRDPlugIn&)> isHeld;
  // What the plug-in's form carries under "annotations", a dictionary;
  // unset: an empty one.
  std::function<Value(const DRDPlugIn&)> annotations;
  // Whether the host may use the plug-in `identifier` (a form's
  // "identifier", "" when it has none).
  std::function<bool(std::string_view identifier)> mayUse;
  std::function<void(const std::string&)> log;    // always written
  std::function<void(const std::string&)> debug;  // written when verbose
};

// The ascending positions in `candidates` of the ones a request with `rules`
// and `flags` must examine, for a host that does or does not need the
// matching workaround; none when every candidate must be. The others would
// each be skipped without a trace (no log line, no flag set, nothing
// returned): rules they fail, and for the workaround host no internal
// filter whose visibility check sets kDiscoverDuplicates. Only the
// verdicts of the candidates left out are lost.
std::optional<std::vector<uint32_t>> CandidatesToExamine(const PlugInSet& candidates,
                                                         const Value& rules, uint64_t flags,
                                                         bool needs17732150Workaround);

// The forms one discovery answers, in order. Each is its record's encoded
// form (made once per record) and what this request adds: the user's
// annotations, tokens for the plug-in's shared resources ("extensions")
// and the replacement marks ("overrider", "overriding").
class DiscoveredForms {
 public:
  struct Form {
    DRDPlugInPtr plugIn;
    std::shared_ptr<const DRPlugInCore::EncodedForm> encoded;
    Value annotations;  // a dictionary
    Value extensions;   // absent when the plug-in shares no resource
    Value overrider;    // absent unless it is replaced
    Value overriding;   // absent unless it replaces another
  };

  size_t size() const { return forms_.size(); }
  const std::vector<Form>& forms() const { return forms_; }
  void add(Form form) { forms_.push_back(std::move(form)); }

  // The array of forms, written into `out` as a value at nesting level
  // DRPlugInCore::kFormDepth - 1, the record's bytes shared.
  void splice(drm1::Splice& out) const;
  // The same array as a value, each form made afresh from its record (for
  // log lines and checks; replies use splice).
  Value value() const;

 private:
  std::vector<Form> forms_;
};

class Discovery {
 public:
  // One candidate's fate. `detail` carries the refusal or error text where
  // there is one; `by` the plug-in that superseded it.
  struct Verdict {
    DRDPlugInPtr plugIn;
    DiscoveryOutcome outcome = DiscoveryOutcome::kReturned;
    std::string detail;
    DRDPlugInPtr by;
  };

  // `rules` is the host's rules dictionary (absent: every plug-in passes);
  // `exclusions` the user's stored value (anything but an array counts as
  // no exclusion; elements that are not dictionaries are skipped).
  Discovery(DiscoveryHost host, Value rules, uint64_t flags, Value exclusions,
            DiscoveryServices services);

  // Examines one candidate; candidates are examined in the order given.
  void examine(const DRDPlugInPtr& candidate);
  // Marks replacements, applies the policy and answers the forms to return,
  // in the order accepted. Call once, after the last examine.
  DiscoveredForms finish();

  // Every candidate examined so far (and, after finish, vetoed ones too),
  // in the order examined.
  const std::vector<Verdict>& verdicts() const { return verdicts_; }
  uint64_t flags() const { return flags_; }

 private:
  struct Accepted {
    size_t verdict;  // index into verdicts_
    DiscoveredForms::Form form;
    bool removed = false;  // superseded by a later copy; kept so positions stay
  };

  std::optional<DiscoveryOutcome> visibility(const DRDPlugIn& candidate);
  // Whether `plugIn` is one of the internal filters older hosts still find
  // outside any application (logged when it is).
  bool plugInMatches17732150Workaround(const DRDPlugIn& plugIn) const;
  // False when the candidate loses against an accepted copy of its
  // identifier; accepted copies it beats are dropped.
  bool resolveDuplicates(const DRDPlugInPtr& candidate, size_t verdict);
  void setOutcome(size_t verdict, DiscoveryOutcome outcome, std::string detail = {},
                  DRDPlugInPtr by = nullptr);
  void debug(const std::string& line) const;

  const DiscoveryHost host_;
  const Value rules_;
  uint64_t flags_;
  const Value exclusions_;
  const DiscoveryServices services_;
  std::vector<Verdict> verdicts_;
  std::vector<Accepted> accepted_;  // in the order accepted
  // Identifier -> positions in accepted_ of its copies still accepted, in
  // order, so that a duplicate is checked against its own copies only.
  std::unordered_map<std::string, std::vector<size_t>> acceptedByIdentifier_;
  // Replaced identifier -> the replacer (its position in accepted_ and its
  // form's "uuid"). Kept when the replacer is later dropped as a duplicate.
  struct Replacer {
    size_t accepted;
    Value uuid;
  };
  std::map<std::string, Replacer> replacements_;
};

}  // namespace dr
