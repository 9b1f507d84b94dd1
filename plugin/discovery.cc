#include "plugin/discovery.h"

#include <algorithm>
#include <array>
#include <cstdint>
#include <iterator>

#include "core/format.h"
#include "plugin/helpers.h"
#include "plugin/plugin_keys.h"

namespace dr {
namespace {

// The older hosts that need the workaround below these versions.
struct WorkaroundHost {
  const char* identifier;
  const char* thresholdVersion;
};
constexpr WorkaroundHost kWorkaroundHosts[] = {
    {"com.corvel.Quellor", "4.2"},       {"com.corvel.Brivane", "10.2"},
    {"com.corvel.BrivaneTrial", "10.2"}, {"com.corvel.vorelapp", "5.2"},
    {"com.corvel.OdelloApp", "10.2"},
};

constexpr const char* kReplaceEntitlement = "com.corvel.developer.replace-plugin";

}  // namespace

bool Needs17732150Workaround(std::string_view identifier, std::string_view version) {
  for (const WorkaroundHost& host : kWorkaroundHosts) {
    if (identifier == host.identifier) {
      return compareVersionString(host.thresholdVersion, version) > 0;
    }
  }
  return false;
}

const char* DiscoveryOutcomeName(DiscoveryOutcome outcome) {
  switch (outcome) {
    case DiscoveryOutcome::kReturned:
      return "returned";
    case DiscoveryOutcome::kHybrid:
      return "hybrid (the host did not ask for hybrid plug-ins)";
    case DiscoveryOutcome::kNotInApplication:
      return "not on the system volume and inside no application";
    case DiscoveryOutcome::kSystemOnly:
      return "not on the system volume (the host asked for system plug-ins only)";
    case DiscoveryOutcome::kDedicatedElsewhere:
      return "dedicated to another application";
    case DiscoveryOutcome::kHeld:
      return "held";
    case DiscoveryOutcome::kRulesMismatch:
      return "does not match the host's rules";
    case DiscoveryOutcome::kExcluded:
      return "excluded by the user";
    case DiscoveryOutcome::kNotAuthorized:
      return "not authorized for the host";
    case DiscoveryOutcome::kSuperseded:
      return "superseded by another copy";
    case DiscoveryOutcome::kVetoed:
      return "denied by the administrator's policy";
  }
  return "unknown";
}

std::optional<std::vector<uint32_t>> CandidatesToExamine(const PlugInSet& candidates,
                                                         const Value& rules, uint64_t flags,
                                                         bool needs17732150Workaround) {
  std::optional<std::vector<uint32_t>> chosen = candidates.mayMatch(rules);
  // kDiscoverAll skips the visibility checks, and with them the workaround.
  if (!chosen || !needs17732150Workaround || (flags & message::kDiscoverAll)) return chosen;
  const std::vector<uint32_t>& filters = candidates.internalFilters();
  std::vector<uint32_t> merged;
  merged.reserve(chosen->size() + filters.size());
  std::set_union(chosen->begin(), chosen->end(), filters.begin(), filters.end(),
                 std::back_inserter(merged));
  return merged;
}

Discovery::Discovery(DiscoveryHost host, Value rules, uint64_t flags, Value exclusions,
                     DiscoveryServices services)
    : host_(std::move(host)),
      rules_(std::move(rules)),
      flags_(flags),
      exclusions_(exclusions.isArray() ? std::move(exclusions) : Value()),
      services_(std::move(services)) {}

void Discovery::debug(const std::string& line) const {
  if (services_.debug) services_.debug(line);
}

void Discovery::setOutcome(size_t verdict, DiscoveryOutcome outcome, std::string detail,
                           DRDPlugInPtr by) {
  Verdict& v = verdicts_[verdict];
  v.outcome = outcome;
  v.detail = std::move(detail);
  v.by = std::move(by);
}

bool Discovery::plugInMatches17732150Workaround(const DRDPlugIn& plugIn) const {
  const std::string path = plugIn.path().value_or("");
  if (!Is17732150Path(path)) return false;
  if (services_.log) {
    services_.log(Format("PlugIn matching for %@[%d] found a 17732150 PlugIn: %@",
                         host_.bundleIdentifier, host_.client->pid(), path));
  }
  return true;
}

std::optional<DiscoveryOutcome> Discovery::visibility(const DRDPlugIn& candidate) {
  if (candidate.isHybrid() && !(flags_ & message::kDiscoverHybrid))
    return DiscoveryOutcome::kHybrid;
  if (!candidate.onSystemVolume()) {
    if (!candidate.containingUrl()) {
      if (!host_.needs17732150Workaround || !plugInMatches17732150Workaround(candidate)) {
        return DiscoveryOutcome::kNotInApplication;
      }
      flags_ |= message::kDiscoverDuplicates;
    }
    if (flags_ & message::kDiscoverSystemOnly) return DiscoveryOutcome::kSystemOnly;
  }
  if (candidate.isDedicated()) {
    // A plain prefix test: the host's own plug-ins folder holds its
    // dedicated plug-ins.
    const std::string path = candidate.path().value_or("");
    if (!host_.plugInsPath || path.compare(0, host_.plugInsPath->size(), *host_.plugInsPath) != 0) {
      return DiscoveryOutcome::kDedicatedElsewhere;
    }
  }
  if (services_.isHeld && services_.isHeld(candidate)) return DiscoveryOutcome::kHeld;
  return std::nullopt;
}

void Discovery::examine(const DRDPlugInPtr& candidate) {
  if (!candidate) return;
  const size_t verdict = verdicts_.size();
  verdicts_.push_back({candidate, DiscoveryOutcome::kReturned, {}, nullptr});
  const DRDPlugIn& p = *candidate;
  const pid_t pid = host_.client->pid();
  const bool all = flags_ & message::kDiscoverAll;

  if (!all) {
    if (std::optional<DiscoveryOutcome> hidden = visibility(p)) {
      setOutcome(verdict, *hidden);
      return;
    }
  }
  if (!p.match(rules_)) {
    setOutcome(verdict, DiscoveryOutcome::kRulesMismatch);
    return;
  }
  for (const Value& exclusion : exclusions_.array()) {
    if (!exclusion.isDictionary()) continue;  // only rules dictionaries are evaluated
    if (p.match(exclusion)) {
      debug(Format("client %d plugin %@ excluded", pid, p.identifier()));
      setOutcome(verdict, DiscoveryOutcome::kExcluded, exclusion.description());
      return;
    }
  }
  if (!all) {
    if (std::optional<std::string> refusal = p.allowForClient(*host_.client)) {
      debug(Format("client %d cannot use plugin %@: %@", pid, p.identifier(), *refusal));
      setOutcome(verdict, DiscoveryOutcome::kNotAuthorized, *refusal);
      return;
    }
  }
  if (!resolveDuplicates(candidate, verdict)) return;

  // The record's encoded form, and what this request adds to it.
  DiscoveredForms::Form form{
      candidate,
      p.encodedForm(),
      services_.annotations ? services_.annotations(p) : DRPlugInCore::NoAnnotations(),
      p.formExtensions(),
      Value(),
      Value()};
  const Value& uuid = form.encoded->uuid;
  const size_t position = accepted_.size();
  if (const Value& id = form.encoded->identifier; id.isString()) {
    acceptedByIdentifier_[id.stringValue()].push_back(position);
  }
  accepted_.push_back({verdict, std::move(form)});

  const Value replaces = p.valueForEntitlement(kReplaceEntitlement);
  auto replace = [&](const Value& identifier) {
    if (identifier.isString()) {
      replacements_[identifier.stringValue()] = {position, uuid};
    }
  };
  if (replaces.isArray()) {
    for (const Value& identifier : replaces.array()) replace(identifier);
  } else {
    replace(replaces);
  }
}

bool Discovery::resolveDuplicates(const DRDPlugInPtr& candidate, size_t verdict) {
  const DRDPlugIn& p = *candidate;
  auto same = acceptedByIdentifier_.find(p.identifier().value_or(""));
  if (same == acceptedByIdentifier_.end()) return true;
  const std::string version = p.version().value_or("");
  std::vector<size_t>& positions = same->second;  // in the order accepted
  for (auto it = positions.begin(); it != positions.end(); ++it) {
    Accepted& existing = accepted_[*it];
    const DRDPlugIn& e = *existing.form.plugIn;
    const int order = compareVersionString(version, e.version().value_or(""));
    const bool fresher =
        (p.onSystemVolume() && !e.onSystemVolume()) || p.lastModified() > e.lastModified();
    bool replaceExisting;
    if (flags_ & message::kDiscoverAllVersions) {
      if ((flags_ & message::kDiscoverDuplicates) || order != 0) continue;  // both stay
      replaceExisting = fresher;
    } else if (order == 0) {
      replaceExisting = fresher;
    } else {
      replaceExisting = order > 0;
    }
    if (!replaceExisting) {
      setOutcome(verdict, DiscoveryOutcome::kSuperseded, {}, existing.form.plugIn);
      return false;
    }
    setOutcome(existing.verdict, DiscoveryOutcome::kSuperseded, {}, candidate);
    existing.removed = true;
    positions.erase(it);
    return true;
  }
  return true;
}

DiscoveredForms Discovery::finish() {
  if (!replacements_.empty()) {
    for (Accepted& a : accepted_) {
      const Value& identifier = a.form.encoded->identifier;
      if (a.removed || !identifier.isString()) continue;
      auto found = replacements_.find(identifier.stringValue());
      if (found == replacements_.end()) continue;
      const Replacer& r = found->second;
      a.form.overrider = r.uuid;
      // A replacer dropped as a duplicate meanwhile has no form to mark.
      Accepted& replacer = accepted_[r.accepted];
      if (!replacer.removed) replacer.form.overriding = identifier;
    }
  }
  DiscoveredForms matches;
  const pid_t pid = host_.client->pid();
  for (Accepted& a : accepted_) {
    if (a.removed) continue;
    const Value& identifier = a.form.encoded->identifier;
    if (services_.mayUse && !services_.mayUse(identifier.stringValue())) {
      debug(Format("client %d plugin %@ rejected by Keeper", pid, identifier));
      setOutcome(a.verdict, DiscoveryOutcome::kVetoed);
      continue;
    }
    matches.add(std::move(a.form));
  }
  return matches;
}

namespace {

// What a request adds to a form, in the order of kFormRequestKeys.
std::array<const Value*, 4> AddedEntries(const DiscoveredForms::Form& form) {
  return {&form.annotations, &form.extensions, &form.overrider, &form.overriding};
}

}  // namespace

// Each form is the record's entries with the request's spliced in where
// their keys sort (a record's own form has none of them).
void DiscoveredForms::splice(drm1::Splice& out) const {
  constexpr int kDepth = DRPlugInCore::kFormDepth;
  out.container(drm1::kTagArray, static_cast<uint32_t>(forms_.size()), kDepth - 1);
  for (const Form& form : forms_) {
    const std::shared_ptr<const drm1::EncodedEntries> entries(form.encoded, &form.encoded->entries);
    const std::array<const Value*, 4> added = AddedEntries(form);
    size_t count = entries->count();
    for (const Value* value : added) count += value->isPresent() ? 1 : 0;
    out.container(drm1::kTagDictionary, static_cast<uint32_t>(count), kDepth);
    size_t next = 0;
    for (size_t i = 0; i < added.size(); ++i) {
      if (added[i]->isAbsent()) continue;
      const size_t at = form.encoded->requestKeyAt[i];
      out.entries(entries, next, at);
      out.key(kFormRequestKeys[i]);
      out.value(*added[i], kDepth + 1);
      next = at;
    }
    out.entries(entries, next, SIZE_MAX);
  }
}

Value DiscoveredForms::value() const {
  Array forms;
  forms.reserve(forms_.size());
  for (const Form& form : forms_) {
    Dictionary entries = form.plugIn->formEntries();
    const std::array<const Value*, 4> added = AddedEntries(form);
    for (size_t i = 0; i < added.size(); ++i) {
      if (added[i]->isPresent()) entries.insert_or_assign(kFormRequestKeys[i], *added[i]);
    }
    forms.push_back(Value(std::move(entries)));
  }
  return Value(std::move(forms));
}

}  // namespace dr
